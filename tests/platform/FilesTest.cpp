#include "platform/linux/Files.h"
#include "platform/linux/PeerProcess.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/FilesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <fstream>
#include <functional>
#include <latch>
#include <map>
#include <sys/mount.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <thread>

using namespace platform;
namespace fs = std::filesystem;

namespace {

constexpr std::size_t anySize = 1 << 20;

/// An empty directory behind a Files implementation, and a peer who reaches it.
struct FakeSubject {
    support::FakeFiles files;
    std::string directory = "/scratch";
    AuditToken peer;
    FakeSubject() {
        files.addDirectory(directory);
        files.allowPeers(peer.uid);
    }
    void link(const std::string& target, const std::string& path) { files.links[path] = target; }
};
struct LinuxSubject {
    support::ScratchDirectory scratch;
    linux_::Files files{linux_::Root("/")};
    std::string directory = scratch.path();
    AuditToken peer{getpid(), getuid(), getgid(), linux_::LinuxPeerProcess::look(getpid())};
    static void link(const std::string& target, const std::string& path) { fs::create_symlink(target, path); }
};

template <class Subject> class FilesConformance : public testing::Test {
protected:
    Subject subject;
    platform::Files& files = subject.files;
    std::string at(const std::string& name) const { return subject.directory + "/" + name; }
    static std::int64_t code(const auto& result) { return result ? 0 : result.error().code; }
};
using Subjects = testing::Types<FakeSubject, LinuxSubject>;
TYPED_TEST_SUITE(FilesConformance, Subjects);

class LinuxFiles : public testing::Test {
protected:
    support::ScratchDirectory scratch;
    linux_::Files files{linux_::Root("/")};
    std::string path = scratch / "file";

    std::string contents() {
        const auto bytes = files.read(path, anySize);
        return bytes ? *bytes : "?";
    }
    std::size_t entries() const {
        return static_cast<std::size_t>(std::distance(fs::directory_iterator(scratch.path()), {}));
    }
    struct stat status() const {
        struct stat status{};
        EXPECT_EQ(stat(path.c_str(), &status), 0);
        return status;
    }
};

} // namespace

TYPED_TEST(FilesConformance, ReadAndWriteTellWhatIsWrong) {
    ASSERT_FALSE(this->files.writeAtomically(this->at("file"), "12345"));
    EXPECT_EQ(*this->files.read(this->at("file"), 5), "12345");
    EXPECT_EQ(this->code(this->files.read(this->at("file"), 4)), fileReadTooLargeCode);
    EXPECT_EQ(this->code(this->files.read(this->at("missing"), anySize)), fileReadNoSuchFileCode);
    EXPECT_EQ(this->code(this->files.read(this->subject.directory, anySize)), fileReadUnknownCode);
    EXPECT_EQ(this->files.writeAtomically(this->subject.directory, "x")->code, fileWriteUnknownCode);
    EXPECT_EQ(this->files.writeAtomically(this->at("missing/file"), "x")->code, fileWriteUnknownCode);
}

TYPED_TEST(FilesConformance, WriteReplacesTheWholeAlsoBehindALink) {
    this->subject.link(this->at("target"), this->at("link")); // nothing there yet
    for (std::string_view bytes : {std::string_view("long content"), std::string_view("a\0b", 3), std::string_view()}) {
        ASSERT_FALSE(this->files.writeAtomically(this->at("link"), bytes));
        EXPECT_EQ(*this->files.read(this->at("target"), anySize), bytes);
    }
}

TYPED_TEST(FilesConformance, SetAsideRenamesWhatALinkLeadsTo) {
    this->subject.link(this->at("target"), this->at("link"));
    for (const char* bytes : {"first", "second"}) {
        ASSERT_FALSE(this->files.writeAtomically(this->at("link"), bytes));
        EXPECT_EQ(this->files.setAside(this->at("link"), ".old"), std::nullopt);
        EXPECT_EQ(*this->files.read(this->at("target.old"), anySize), bytes);
        EXPECT_EQ(this->files.setAside(this->at("link"), ".old")->code, fileReadNoSuchFileCode);
    }
    EXPECT_EQ(this->files.setAside(this->subject.directory, ".old")->code, fileWriteUnknownCode);
}

TYPED_TEST(FilesConformance, RealPathFollowsLinksAndKeepsItsLimit) {
    const std::string target = this->at("file");
    ASSERT_FALSE(this->files.writeAtomically(target, "x"));
    this->subject.link(target, this->at("link"));
    const std::function<Result<std::string>(const std::string&, std::size_t)> ways[] = {
        [&](const auto& path, auto limit) { return this->files.realPath(path, limit); },
        [&](const auto& path, auto limit) { return this->files.realPath(path, limit, this->subject.peer); },
    };
    for (const auto& realPath : ways) {
        EXPECT_EQ(*realPath(this->at("link"), target.size() + 1), target);
        EXPECT_FALSE(realPath(this->at("link"), target.size()));
        EXPECT_EQ(this->code(realPath(this->at("missing"), anySize)), fileReadNoSuchFileCode);
    }
}

TEST_F(LinuxFiles, RealPathReachesWhatThePeerReaches) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    constexpr gid_t friends = 4711;
    const auto as = [&](uid_t user, std::vector<gid_t> groups, const std::string& wanted) {
        const auto process = linux_::LinuxPeerProcess::look(getpid(), linux_::Descriptor(), std::move(groups));
        return files.realPath(wanted, anySize, AuditToken{getpid(), user, user, process}).operator bool();
    };
    ASSERT_FALSE(files.writeAtomically(path, "x"));
    ASSERT_EQ(chown(scratch.path().c_str(), 0, friends), 0);
    ASSERT_EQ(chmod(scratch.path().c_str(), 0710), 0);
    EXPECT_FALSE(as(support::ordinaryUser, {}, path));
    EXPECT_TRUE(as(support::ordinaryUser, {}, scratch.path())) << "its name is in a directory open to everybody";
    EXPECT_TRUE(as(support::ordinaryUser, {friends}, path));
    EXPECT_TRUE(as(0, {}, path)) << "root's own rights again";
    // Reading these links is root's right, and they tell what other processes have open.
    for (const char* link : {"/proc/self/cwd", "/proc/self/exe", "/proc/1/root", "/proc/1/cwd/tmp"})
        EXPECT_FALSE(as(support::ordinaryUser, {}, link)) << link;
    EXPECT_FALSE(files.realPath("/tmp", anySize, AuditToken{getpid(), support::ordinaryUser, 0, nullptr}))
        << "nobody knows the groups";
}

TEST_F(LinuxFiles, WhatIsNoRegularFileIsNeitherReadNorReplaced) {
    ASSERT_EQ(mkfifo((scratch / "pipe").c_str(), 0600), 0);
    fs::create_symlink("/dev/zero", scratch / "device");
    fs::create_symlink("loop", scratch / "loop");
    const std::pair<const char*, const char*> cases[] = {
        {"pipe", "not a regular file"}, {"device", "not a regular file"}, {"loop", ""}, {".", "Is a directory"}};
    for (const auto& [name, reason] : cases) {
        const auto result = files.read(scratch / name, anySize);
        ASSERT_FALSE(result) << name;
        EXPECT_EQ(result.error().code, fileReadUnknownCode) << name;
        EXPECT_NE(result.error().text().find(reason), std::string::npos) << name;
    }
    for (const char* name : {"pipe", "loop", "."})
        EXPECT_EQ(files.writeAtomically(scratch / name, "x")->code, fileWriteUnknownCode) << name;
    EXPECT_TRUE(fs::is_fifo(scratch / "pipe"));
    EXPECT_EQ(entries(), 3U);
}

TEST_F(LinuxFiles, ReadGoesToTheEndOfFilesThatTellNoSize) {
    const auto maps = files.read("/proc/self/smaps", anySize * 16); // many pages, said to have no byte
    ASSERT_TRUE(maps);
    EXPECT_GT(static_cast<std::ptrdiff_t>(maps->rfind("VmFlags:")), 8192);
    EXPECT_EQ(files.read("/proc/self/smaps", 100).error().code, fileReadTooLargeCode);
}

TEST_F(LinuxFiles, PermissionsAreErrorsOfTheirOwn) {
    ASSERT_FALSE(files.writeAtomically(path, "secret"));
    ASSERT_TRUE(chmod(path.c_str(), 0) == 0 && chmod(scratch.path().c_str(), 0555) == 0);
    EXPECT_EQ(support::resultInChild([&] {
                  if (!support::becomeOrdinaryUser()) return 9;
                  if (files.read(path, anySize).error().code != fileReadNoPermissionCode) return 1;
                  return files.writeAtomically(path, "x")->code == fileWriteNoPermissionCode ? 0 : 2;
              }),
              0);
    chmod(scratch.path().c_str(), 0700);
}

TEST_F(LinuxFiles, WriteKeepsModeAndOwnerAlsoOfTheLongestName) {
    path = scratch / std::string(255, 'n');
    EXPECT_TRUE(files.writeAtomically(path + "n", "x"));
    ASSERT_FALSE(files.writeAtomically(path, "new"));
    EXPECT_EQ(status().st_mode & 07777U, 0600U);
    ASSERT_EQ(chmod(path.c_str(), 0640), 0);
    const bool privileged = geteuid() == 0;
    ASSERT_TRUE(!privileged || chown(path.c_str(), 12, 34) == 0);
    ASSERT_FALSE(files.writeAtomically(path, "newer"));
    EXPECT_EQ(contents(), "newer");
    EXPECT_EQ(status().st_mode & 07777U, 0640U);
    EXPECT_TRUE(!privileged || (status().st_uid == 12 && status().st_gid == 34));
    EXPECT_EQ(entries(), 1U);
}

TEST_F(LinuxFiles, WhatLiesAtTheTemporaryNameIsNotWrittenThrough) {
    const std::string temporary = scratch / ".file.saving";
    const std::string victim = scratch / "victim";
    const std::function<void()> traps[] = {
        [&] { fs::create_symlink(victim, temporary); },
        [&] { fs::create_hard_link(victim, temporary); },
        [&] { ASSERT_EQ(mkfifo(temporary.c_str(), 0600), 0); },
        [&] { std::ofstream(temporary) << "left by a killed save, and longer than the next one"; },
    };
    for (const auto& trap : traps) {
        std::ofstream(victim) << "untouched";
        trap();
        ASSERT_FALSE(files.writeAtomically(path, "saved"));
        EXPECT_EQ(contents(), "saved");
        EXPECT_EQ(*files.read(victim, anySize), "untouched");
        EXPECT_TRUE(fs::is_regular_file(fs::symlink_status(path)));
        EXPECT_EQ(entries(), 2U);
    }
}

TEST_F(LinuxFiles, LackOfRoomLeavesTheOldFileAlone) {
    const std::string large(100'000, 'x');
    const std::function<bool()> lacks[] = {
        [&] {
            rlimit limit{50'000, 50'000};
            return signal(SIGXFSZ, SIG_IGN) != SIG_ERR && setrlimit(RLIMIT_FSIZE, &limit) == 0;
        },
        [&] {
            return unshare(CLONE_NEWNS) == 0 && mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
                   mount("none", scratch.path().c_str(), "tmpfs", 0, "size=64k") == 0;
        },
    };
    for (const auto& makeLack : lacks) {
        const int result = support::resultInChild([&] {
            if (!makeLack()) return 9;
            if (files.writeAtomically(path, "old")) return 1;
            const auto failure = files.writeAtomically(path, large);
            if (!failure || failure->code != fileWriteOutOfSpaceCode) return 2;
            if (contents() != "old" || entries() != 1) return 3;
            return files.writeAtomically(path, "new") ? 4 : 0; // the failed save's space is free again
        });
        if (result == 9) GTEST_SKIP() << "may not mount";
        EXPECT_EQ(result, 0);
    }
}

TEST_F(LinuxFiles, WritersTakeTurns) {
    const auto write = [&](char letter) { EXPECT_FALSE(files.writeAtomically(path, std::string(50'000, letter))); };
    write('a');
    std::latch start(3);
    const auto writer = [&](char letter) {
        start.arrive_and_wait();
        for (int round = 0; round < 50; ++round) write(letter);
    };
    {
        const std::jthread first(writer, 'a');
        const std::jthread second(writer, 'b');
        start.arrive_and_wait();
        for (int round = 0; round < 200; ++round) {
            const std::string seen = contents();
            EXPECT_EQ(seen, std::string(50'000, seen[0]));
        }
    }
    EXPECT_EQ(entries(), 1U);
}

// Kills a save at each of its system calls in turn, before and after the call.
TEST_F(LinuxFiles, KilledSaveLeavesTheOldOrTheNewFile) {
    const std::string old(10'000, 'o');
    const std::string fresh(20'000, 'n');
    std::map<std::string, int> seen;
    int status = 0;
    for (int stops = 1; !WIFEXITED(status) || stops == 1; ++stops) {
        ASSERT_LT(stops, 1000);
        ASSERT_FALSE(files.writeAtomically(path, old)); // also takes over what the killed one left
        ASSERT_EQ(entries(), 1U);
        const pid_t child = fork();
        if (child == 0) {
            if (ptrace(PTRACE_TRACEME, 0, nullptr, nullptr) != 0) _exit(9);
            raise(SIGSTOP);
            _exit(files.writeAtomically(path, fresh) ? 1 : 0);
        }
        ASSERT_EQ(waitpid(child, &status, 0), child);
        if (WIFEXITED(status)) GTEST_SKIP() << "may not trace";
        for (int stop = 0; stop < stops && !WIFEXITED(status); ++stop) {
            ASSERT_EQ(ptrace(PTRACE_SYSCALL, child, nullptr, nullptr), 0);
            ASSERT_EQ(waitpid(child, &status, 0), child);
        }
        if (WIFEXITED(status)) {
            EXPECT_EQ(WEXITSTATUS(status), 0);
        } else {
            kill(child, SIGKILL);
            ASSERT_EQ(waitpid(child, nullptr, 0), child);
        }
        ++seen[contents()];
        ASSERT_EQ(seen[old] + seen[fresh], stops) << contents().size() << " bytes";
        ASSERT_LE(entries(), 2U);
    }
    EXPECT_GT(seen[old], 10); // open, lock, write, sync: each with its two sides
    EXPECT_GT(seen[fresh], 1);
}
