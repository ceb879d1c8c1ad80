#include "platform/TracePoints.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <elf.h>
#include <fstream>
#include <link.h>
#include <map>
#include <sstream>
#include <string>
#include <utility>

extern "C" {
extern volatile unsigned short zbd_request__input_semaphore;
extern volatile unsigned short zbd_request__output_semaphore;
}

namespace {

/// One trace point as tracers find it in the program's file.
struct Note {
    std::string arguments;
    std::uint64_t location;
    std::uint64_t semaphore;
};

template <class T> T readAt(const std::string& bytes, std::size_t at) {
    T value{};
    if (at + sizeof value <= bytes.size()) std::memcpy(&value, bytes.data() + at, sizeof value);
    return value;
}

std::map<std::string, Note> notesOfThisProgram(const std::string& wantedProvider) {
    std::ifstream file("/proc/self/exe", std::ios::binary);
    std::ostringstream content;
    content << file.rdbuf();
    const std::string bytes = std::move(content).str();
    const auto header = readAt<ElfW(Ehdr)>(bytes, 0);
    const auto sectionAt = [&](std::size_t index) {
        return readAt<ElfW(Shdr)>(bytes, header.e_shoff + index * header.e_shentsize);
    };
    const auto names = sectionAt(header.e_shstrndx);
    std::map<std::string, Note> notes;
    for (std::size_t i = 0; i < header.e_shnum; ++i) {
        const auto section = sectionAt(i);
        if (std::string(bytes.data() + names.sh_offset + section.sh_name) != ".note.stapsdt") continue;
        std::size_t at = section.sh_offset;
        while (at < section.sh_offset + section.sh_size) {
            const auto note = readAt<ElfW(Nhdr)>(bytes, at);
            const std::size_t body = at + sizeof note + ((note.n_namesz + 3U) & ~3U);
            // Three addresses (the point, a base, the semaphore), then three texts.
            const char* provider = bytes.data() + body + 3 * sizeof(std::uint64_t);
            const char* name = provider + std::strlen(provider) + 1;
            if (provider == wantedProvider)
                notes[name] = {name + std::strlen(name) + 1, readAt<std::uint64_t>(bytes, body),
                               readAt<std::uint64_t>(bytes, body + 2 * sizeof(std::uint64_t))};
            at = body + ((note.n_descsz + 3U) & ~3U);
        }
    }
    return notes;
}

/// Where this program was loaded.
std::uint64_t loadAddress() {
    std::uint64_t address = 0;
    dl_iterate_phdr(
        [](dl_phdr_info* info, std::size_t, void* result) {
            *static_cast<std::uint64_t*>(result) = info->dlpi_addr;
            return 1; // the first one is the program itself
        },
        &address);
    return address;
}

/// The sizes of the arguments, signed ones negative: "-4@%edi 8@%rsi" gives "-4 8".
std::string sizesOf(const std::string& arguments) {
    std::string sizes;
    bool isOperand = false;
    for (const char c : arguments) {
        if (c == '@') isOperand = true;
        if (c == ' ') isOperand = false;
        if (!isOperand) sizes += c;
    }
    return sizes;
}

TEST(TracePoints, TracersFindAllPointsWithTheirArgumentsAndSemaphores) {
    const std::map<std::string, std::string> expected{
        {"client__new", "-4"},       {"client__done", "-4"}, {"request__input", "-4 8"}, {"request", "-4 8"},
        {"request__output", "-4 8"}, {"plugin__add", "8"},   {"plugin__remove", "8 1"},  {"plugin__ready", "8"},
        {"discover__raw", "4"},      {"db__load", "8 8"},
    };
    const auto notes = notesOfThisProgram("zbd");
    std::map<std::string, std::string> found;
    std::map<std::uint64_t, std::string> semaphores;
    for (const auto& [name, note] : notes) {
        found[name] = sizesOf(note.arguments);
        EXPECT_NE(note.location, 0U) << name;
        EXPECT_NE(note.semaphore, 0U) << name;
        semaphores[note.semaphore] = name;
    }
    EXPECT_EQ(found, expected);
    EXPECT_EQ(semaphores.size(), expected.size()); // one of its own each
}

TEST(TracePoints, PointsAreEnabledWhileTheirSemaphoreIsRaised) {
    const auto notes = notesOfThisProgram("zbd");
    ASSERT_TRUE(notes.contains("request__input") && notes.contains("request__output"));
    struct Case {
        const char* name;
        volatile unsigned short* semaphore;
        bool (*isEnabled)() noexcept;
    };
    for (const Case& each :
         {Case{"request__input", &zbd_request__input_semaphore, platform::trace::requestInputEnabled},
          Case{"request__output", &zbd_request__output_semaphore, platform::trace::requestOutputEnabled}}) {
        SCOPED_TRACE(each.name);
        // What tracers raise is what the program reads.
        EXPECT_EQ(reinterpret_cast<std::uint64_t>(each.semaphore), loadAddress() + notes.at(each.name).semaphore);
        EXPECT_FALSE(each.isEnabled());
        *each.semaphore = 1;
        EXPECT_TRUE(each.isEnabled());
        *each.semaphore = 0;
        EXPECT_FALSE(each.isEnabled());
    }
}

} // namespace
