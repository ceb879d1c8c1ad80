#include "platform/linux/Files.h"
#include "platform/linux/PeerProcess.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/FilesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <fstream>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <thread>

using namespace platform;
namespace fs = std::filesystem;

namespace {

constexpr std::size_t anySize = 1 << 20;

/// An empty directory behind a Files implementation, and a peer who reaches it.
struct FakeWorld {
    support::FakeFiles files;
    std::string directory = "/scratch";
    AuditToken peer;
    FakeWorld() {
        files.addDirectory(directory);
        files.allowPeers(peer.uid);
    }
    void link(const std::string& target, const std::string& path) { files.links[path] = target; }
};
struct LinuxWorld {
    support::ScratchDirectory scratch;
    linux_::Files files{linux_::Root("/")};
    std::string directory = scratch.path();
    AuditToken peer{getpid(), getuid(), getgid(), linux_::LinuxPeerProcess::look(getpid())};
    static void link(const std::string& target, const std::string& path) { fs::create_symlink(target, path); }
};
template <class World> class FilesConformance : public testing::Test {};
using Worlds = testing::Types<FakeWorld, LinuxWorld>;
TYPED_TEST_SUITE(FilesConformance, Worlds);

class LinuxFiles : public testing::Test, protected LinuxWorld {
protected:
    std::string path = scratch / "file";

    std::string contents() { return *files.read(path, anySize); }
    std::size_t entries() const {
        return static_cast<std::size_t>(std::distance(fs::directory_iterator(directory), {}));
    }
};

std::int64_t codeOf(const auto& result) { return result ? 0 : result.error().code; }

TYPED_TEST(FilesConformance, ReadWriteAndSetAsideFollowALink) {
    TypeParam world;
    const std::string target = world.directory + "/target";
    const std::string link = world.directory + "/link";
    world.link(target, link); // nothing there yet
    for (std::string_view bytes : {std::string_view("short"), std::string_view("a\0b", 3), std::string_view()}) {
        EXPECT_FALSE(world.files.writeAtomically(link, "old and longer"));
        EXPECT_FALSE(world.files.writeAtomically(link, bytes));
        EXPECT_EQ(*world.files.read(link, bytes.size()), bytes);
        EXPECT_FALSE(world.files.setAside(link, ".old"));
        EXPECT_EQ(*world.files.read(target + ".old", anySize), bytes);
        EXPECT_EQ(world.files.setAside(link, ".old")->code, fileReadNoSuchFileCode);
    }
    EXPECT_FALSE(world.files.writeAtomically(link, "12345"));
    EXPECT_EQ(codeOf(world.files.read(link, 4)), fileReadTooLargeCode);
    EXPECT_EQ(codeOf(world.files.read(target + "missing", anySize)), fileReadNoSuchFileCode);
    EXPECT_EQ(codeOf(world.files.read(world.directory, anySize)), fileReadUnknownCode);
    EXPECT_EQ(world.files.writeAtomically(world.directory, "x")->code, fileWriteUnknownCode);
    EXPECT_EQ(world.files.writeAtomically(world.directory + "/missing/file", "x")->code, fileWriteUnknownCode);
    EXPECT_EQ(world.files.setAside(world.directory, ".old")->code, fileWriteUnknownCode);
}

TYPED_TEST(FilesConformance, RealPathFollowsLinksAndKeepsItsLimit) {
    TypeParam world;
    const std::string target = world.directory + "/target";
    world.link(target, world.directory + "/link");
    const auto expect = [&](const auto&... peer) {
        EXPECT_EQ(codeOf(world.files.realPath(target, anySize, peer...)), fileReadNoSuchFileCode);
        EXPECT_FALSE(world.files.writeAtomically(target, "x"));
        EXPECT_EQ(*world.files.realPath(world.directory + "/link", target.size() + 1, peer...), target);
        EXPECT_FALSE(world.files.realPath(target, target.size(), peer...));
        EXPECT_FALSE(world.files.setAside(target, ".old"));
    };
    expect();
    expect(world.peer);
}

TEST_F(LinuxFiles, RealPathReachesWhatThePeersGroupsReach) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    constexpr gid_t friends = 4711;
    const auto refusalOf = [&](uid_t user, std::vector<gid_t> groups) {
        const auto process = linux_::LinuxPeerProcess::look(getpid(), linux_::Descriptor(), std::move(groups));
        return codeOf(files.realPath(path, anySize, AuditToken{getpid(), user, user, process}));
    };
    EXPECT_FALSE(files.writeAtomically(path, "x"));
    ASSERT_TRUE(chown(directory.c_str(), 0, friends) == 0 && chmod(directory.c_str(), 0710) == 0);
    EXPECT_EQ(refusalOf(support::ordinaryUser, {}), fileReadNoPermissionCode);
    EXPECT_EQ(refusalOf(support::ordinaryUser, {friends}), 0);
    EXPECT_EQ(refusalOf(0, {}), 0) << "root's own rights again";
    EXPECT_FALSE(files.realPath("/tmp", anySize, AuditToken{getpid(), support::ordinaryUser, 0, nullptr}));
}

TEST_F(LinuxFiles, WhatIsNoRegularFileIsNeitherReadNorReplaced) {
    mkfifo((scratch / "pipe").c_str(), 0600);
    fs::create_symlink("/dev/zero", scratch / "device");
    fs::create_symlink("loop", scratch / "loop");
    for (const char* name : {"pipe", "device", "loop"})
        EXPECT_EQ(files.read(scratch / name, anySize).error().code, fileReadUnknownCode) << name;
    for (const char* name : {"pipe", "loop"})
        EXPECT_EQ(files.writeAtomically(scratch / name, "x")->code, fileWriteUnknownCode) << name;
    EXPECT_EQ(files.writeAtomically("/sys/missing", "x")->code, fileWriteNoPermissionCode);
    EXPECT_TRUE(fs::is_fifo(scratch / "pipe"));
    EXPECT_EQ(entries(), 3U);
}

TEST_F(LinuxFiles, ReadGoesToTheEndOfFilesThatTellNoSize) {
    const auto maps = files.read("/proc/self/smaps", anySize * 16); // many pages, said to have no byte
    EXPECT_GT(static_cast<std::ptrdiff_t>(maps->rfind("VmFlags:")), 8192);
    EXPECT_EQ(files.read("/proc/self/smaps", 100).error().code, fileReadTooLargeCode);
}

TEST_F(LinuxFiles, WriteKeepsModeAndOwnerAlsoOfTheLongestName) {
    path = scratch / std::string(255, 'n');
    EXPECT_TRUE(files.writeAtomically(path + "n", "x"));
    EXPECT_FALSE(files.writeAtomically(path, "new"));
    EXPECT_EQ(fs::status(path).permissions(), fs::perms(0600));
    struct stat old{};
    struct stat status{};
    ASSERT_TRUE(chmod(path.c_str(), 0640) == 0 && (geteuid() != 0 || chown(path.c_str(), 12, 34) == 0));
    ASSERT_EQ(stat(path.c_str(), &old), 0);
    EXPECT_FALSE(files.writeAtomically(path, "newer"));
    EXPECT_EQ(contents(), "newer");
    ASSERT_EQ(stat(path.c_str(), &status), 0);
    EXPECT_EQ(std::tuple(status.st_mode, status.st_uid, status.st_gid),
              std::tuple(old.st_mode, old.st_uid, old.st_gid));
    EXPECT_EQ(entries(), 1U);
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
        EXPECT_EQ(contents(), "saved");
        EXPECT_EQ(*files.read(victim, anySize), "untouched");
        EXPECT_TRUE(fs::is_regular_file(fs::symlink_status(path)));
        EXPECT_EQ(entries(), 2U);
    }
}

TEST_F(LinuxFiles, WritersTakeTurns) {
    const auto write = [&](char letter) {
        for (int round = 0; round < 50; ++round) EXPECT_FALSE(files.writeAtomically(path, std::string(50'000, letter)));
    };
    write('a');
    {
        const std::jthread first(write, 'a');
        const std::jthread second(write, 'b');
        for (int round = 0; round < 200; ++round) {
            const std::string seen = contents();
            EXPECT_EQ(seen, std::string(50'000, seen[0]));
        }
    }
    EXPECT_EQ(entries(), 1U);
}

} // namespace
