#include "platform/TracePoints.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <map>
#include <regex>
#include <set>
#include <string>

extern "C" {
extern volatile unsigned short zbd_request__input_semaphore;
extern volatile unsigned short zbd_request__output_semaphore;
}

namespace {

/// One trace point as tracers find it in the program's file.
struct Note {
    std::string argumentSizes; // in bytes, signed ones negative
    std::uint64_t semaphore;
};

std::map<std::string, Note> notesOfThisProgram() {
    const std::string program = std::filesystem::read_symlink("/proc/self/exe");
    std::FILE* pipe = popen(("LC_ALL=C readelf -nW '" + program + "'").c_str(), "r");
    std::string text;
    for (int letter = std::getc(pipe); letter != EOF; letter = std::getc(pipe)) text += static_cast<char>(letter);
    EXPECT_EQ(pclose(pipe), 0);
    const std::regex form(
        "Provider: zbd\\s+Name: (\\S+)\\s+Location: 0x0*[1-9a-f]\\S*, Base: \\S+, Semaphore: (\\S+)\\s+"
        "Arguments: (.*)");
    std::map<std::string, Note> notes;
    for (std::sregex_iterator found(text.begin(), text.end(), form), end; found != end; ++found)
        notes[(*found)[1]] = {std::regex_replace((*found)[3].str(), std::regex("@\\S+| +$"), ""),
                              std::stoull((*found)[2], nullptr, 16)};
    return notes;
}

TEST(TracePoints, TracersFindAllPointsWithTheirArgumentsAndSemaphores) {
    const std::map<std::string, std::string> expected{
        {"client__new", "-4"},       {"client__done", "-4"}, {"request__input", "-4 8"}, {"request", "-4 8"},
        {"request__output", "-4 8"}, {"plugin__add", "8"},   {"plugin__remove", "8 1"},  {"plugin__ready", "8"},
        {"discover__raw", "4"},      {"db__load", "8 8"},
    };
    std::map<std::string, std::string> found;
    std::set<std::uint64_t> semaphores{0};
    for (const auto& [name, note] : notesOfThisProgram()) {
        found[name] = note.argumentSizes;
        EXPECT_TRUE(semaphores.insert(note.semaphore).second) << name << " has none of its own";
    }
    EXPECT_EQ(found, expected);
}

TEST(TracePoints, PointsAreEnabledWhileTheirSemaphoreIsRaised) {
    const auto expectSwitch = [](volatile unsigned short& semaphore, bool (*isEnabled)() noexcept) {
        EXPECT_FALSE(isEnabled());
        semaphore = 1;
        EXPECT_TRUE(isEnabled());
        semaphore = 0;
        EXPECT_FALSE(isEnabled());
    };
    expectSwitch(zbd_request__input_semaphore, platform::trace::requestInputEnabled);
    expectSwitch(zbd_request__output_semaphore, platform::trace::requestOutputEnabled);
    // What tracers raise is what the program reads: the file and the memory have them at the same distance.
    const auto notes = notesOfThisProgram();
    const auto address = [](volatile unsigned short& semaphore) { return reinterpret_cast<std::uint64_t>(&semaphore); };
    EXPECT_EQ(notes.at("request__output").semaphore - notes.at("request__input").semaphore,
              address(zbd_request__output_semaphore) - address(zbd_request__input_semaphore));
}

} // namespace
