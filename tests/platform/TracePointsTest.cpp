#include "platform/TracePoints.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <map>
#include <regex>
#include <set>

extern "C" {
extern volatile unsigned short zbd_request__input_semaphore;
extern volatile unsigned short zbd_request__output_semaphore;
}

TEST(TracePoints, TracersFindAllWithTheirArgumentsAndSemaphores) {
    const std::string program = std::filesystem::read_symlink("/proc/self/exe");
    std::FILE* pipe = popen(("LC_ALL=C readelf -nW '" + program + "'").c_str(), "r");
    std::string text;
    for (int letter = std::getc(pipe); letter != EOF; letter = std::getc(pipe)) text += static_cast<char>(letter);
    EXPECT_EQ(pclose(pipe), 0);
    const std::regex form(
        "Provider: zbd\\s+Name: (\\S+)\\s+Location: 0x0*[1-9a-f]\\S*, Base: \\S+, Semaphore: (\\S+)\\s+"
        "Arguments: (.*)");
    std::map<std::string, std::string> sizes; // of the arguments in bytes, signed ones negative
    std::map<std::string, std::uint64_t> semaphores;
    std::set<std::uint64_t> places{0};
    for (std::sregex_iterator found(text.begin(), text.end(), form), end; found != end; ++found) {
        const std::string name = (*found)[1];
        sizes[name] = std::regex_replace((*found)[3].str(), std::regex("@\\S+| +$"), "");
        semaphores[name] = std::stoull((*found)[2], nullptr, 16);
        EXPECT_TRUE(places.insert(semaphores[name]).second) << name << " has none of its own";
    }
    const std::map<std::string, std::string> expected{
        {"client__new", "-4"},       {"client__done", "-4"}, {"request__input", "-4 8"}, {"request", "-4 8"},
        {"request__output", "-4 8"}, {"plugin__add", "8"},   {"plugin__remove", "8 1"},  {"plugin__ready", "8"},
        {"discover__raw", "4"},      {"db__load", "8 8"},
    };
    EXPECT_EQ(sizes, expected);
    // What tracers raise is what the program reads: the file and the memory have them at the same distance.
    EXPECT_EQ(semaphores["request__output"] - semaphores["request__input"],
              reinterpret_cast<std::uint64_t>(&zbd_request__output_semaphore) -
                  reinterpret_cast<std::uint64_t>(&zbd_request__input_semaphore));
}

TEST(TracePoints, AreEnabledWhileTheirSemaphoreIsRaised) {
    const auto expectSwitch = [](volatile unsigned short& semaphore, bool (*isEnabled)() noexcept) {
        EXPECT_FALSE(isEnabled());
        semaphore = 1;
        EXPECT_TRUE(isEnabled());
        semaphore = 0;
        EXPECT_FALSE(isEnabled());
    };
    expectSwitch(zbd_request__input_semaphore, platform::trace::requestInputEnabled);
    expectSwitch(zbd_request__output_semaphore, platform::trace::requestOutputEnabled);
}
