#include "platform/TracePoints.h"

#include <cstdio>
#include <filesystem>
#include <gtest/gtest.h>
#include <map>
#include <regex>
#include <set>

extern "C" volatile unsigned short zbd_request__input_semaphore;

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
    std::set<std::string> semaphores{"0x0000000000000000"};
    for (std::sregex_iterator found(text.begin(), text.end(), form), end; found != end; ++found) {
        sizes[(*found)[1]] = std::regex_replace((*found)[3].str(), std::regex("@\\S+| +$"), "");
        EXPECT_TRUE(semaphores.insert((*found)[2]).second) << (*found)[1] << " has none of its own";
    }
    const std::map<std::string, std::string> expected{
        {"client__new", "-4"},       {"client__done", "-4"}, {"request__input", "-4 8"}, {"request", "-4 8"},
        {"request__output", "-4 8"}, {"plugin__add", "8"},   {"plugin__remove", "8 1"},  {"plugin__ready", "8"},
        {"discover__raw", "4"},      {"db__load", "8 8"},
    };
    EXPECT_EQ(sizes, expected);
    // What its maker reads is what tracers raise.
    EXPECT_FALSE(platform::trace::requestInputEnabled());
    zbd_request__input_semaphore = 1;
    EXPECT_TRUE(platform::trace::requestInputEnabled());
    zbd_request__input_semaphore = 0;
}
