#include "platform/linux/Files.h"
#include "platform/linux/PeerProcess.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ScratchDirectory.h"

#include <fstream>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <thread>

using namespace platform;
namespace fs = std::filesystem;

namespace {

constexpr std::size_t anySize = 1 << 20;

struct LinuxFiles : testing::Test {
    std::string contents() { return *files.read(path, anySize); }
    auto entries() const { return std::distance(fs::directory_iterator(scratch.path()), {}); }

    support::ScratchDirectory scratch;
    linux_::Files files{linux_::Root("/")};
    const std::string path = scratch / "file";
    const std::string link = scratch / "link";
};

std::int64_t codeOf(const auto& result) { return result ? 0 : result.error().code; }

TEST_F(LinuxFiles, ReadWriteAndSetAsideFollowALink) {
    fs::create_symlink(path, link); // nothing there yet
    for (std::string_view bytes : {std::string_view(), std::string_view("a\0b", 3), std::string_view("short")}) {
        EXPECT_FALSE(files.writeAtomically(link, "old and longer") || files.writeAtomically(link, bytes));
        EXPECT_EQ(*files.read(link, bytes.size()), bytes);
        EXPECT_FALSE(files.setAside(link, ".old"));
        EXPECT_EQ(*files.read(path + ".old", anySize), bytes);
        EXPECT_EQ(files.setAside(link, ".old")->code, fileReadNoSuchFileCode);
    }
}

TEST_F(LinuxFiles, RealPathReachesWhatThePeersGroupsReach) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    constexpr gid_t friends = 4711;
    const auto refusalOf = [&](uid_t user, std::vector<gid_t> groups) {
        const auto process = linux_::LinuxPeerProcess::look(getpid(), linux_::Descriptor(), std::move(groups));
        return codeOf(files.realPath(path, anySize, AuditToken{getpid(), user, user, process}));
    };
    EXPECT_FALSE(files.writeAtomically(path, "x"));
    ASSERT_TRUE(chown(scratch.path().c_str(), 0, friends) == 0 && chmod(scratch.path().c_str(), 0710) == 0);
    EXPECT_EQ(refusalOf(support::ordinaryUser, {}), fileReadNoPermissionCode);
    EXPECT_EQ(refusalOf(support::ordinaryUser, {friends}), 0);
    EXPECT_EQ(refusalOf(0, {}), 0) << "root's own rights again";
    EXPECT_FALSE(files.realPath("/tmp", anySize, AuditToken{getpid(), support::ordinaryUser, 0, nullptr}));
}

TEST_F(LinuxFiles, WhatIsNoRegularFileIsNeitherReadNorReplaced) {
    mkfifo((scratch / "pipe").c_str(), 0600);
    fs::create_symlink("/dev/zero", scratch / "device");
    fs::create_symlink("loop", scratch / "loop");
    fs::create_directory(scratch / "directory");
    for (const char* name : {"pipe", "device", "loop", "directory"})
        EXPECT_EQ(codeOf(files.read(scratch / name, anySize)), fileReadUnknownCode) << name;
    for (const char* name : {"pipe", "loop", "directory", "missing/file"})
        EXPECT_EQ(files.writeAtomically(scratch / name, "x")->code, fileWriteUnknownCode) << name;
    EXPECT_EQ(entries(), 4) << "nothing is left over";
}

TEST_F(LinuxFiles, WhatLiesAtTheTemporaryNameIsNotWrittenThrough) {
    const std::string temporary = scratch / ".file.saving";
    const std::string victim = scratch / "victim";
    const std::function<void()> traps[] = {
        [&] { fs::create_symlink(victim, temporary); },
        [&] { fs::create_hard_link(victim, temporary); },
        [&] { mkfifo(temporary.c_str(), 0600); },
        [&] { std::ofstream(temporary) << "left by a killed save, and longer than the next one"; },
    };
    std::ofstream(victim) << "untouched";
    for (const auto& trap : traps) {
        trap();
        EXPECT_FALSE(files.writeAtomically(path, "saved"));
        EXPECT_EQ(contents() + *files.read(victim, anySize), "saveduntouched");
        EXPECT_TRUE(fs::is_regular_file(fs::symlink_status(path)));
        EXPECT_EQ(fs::status(path).permissions(), fs::perms(0600));
        EXPECT_EQ(entries(), 2);
    }
}

TEST_F(LinuxFiles, WritersTakeTurns) {
    const auto write = [&](char letter) {
        for (int round = 0; round < 50; ++round) EXPECT_FALSE(files.writeAtomically(path, std::string(50'000, letter)));
    };
    write('a');
    chmod(path.c_str(), 0640);
    {
        const std::jthread first(write, 'a');
        const std::jthread second(write, 'b');
        for (int round = 0; round < 200; ++round) {
            const std::string seen = contents();
            EXPECT_EQ(seen, std::string(50'000, seen[0]));
        }
    }
    EXPECT_EQ(fs::status(path).permissions(), fs::perms(0640)) << "kept";
    EXPECT_EQ(entries(), 1);
}

} // namespace
