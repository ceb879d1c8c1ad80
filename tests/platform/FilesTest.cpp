#include "platform/linux/Files.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/FilesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <fstream>
#include <latch>
#include <sys/mount.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <thread>

using namespace platform;
namespace fs = std::filesystem;

namespace {

constexpr std::size_t anySize = 1 << 20;

/// An empty directory behind a Files implementation.
struct FakeSubject {
    support::FakeFiles files;
    std::string directory = "/scratch";
    FakeSubject() { files.addDirectory(directory); }
    void link(const std::string& target, const std::string& path) { files.links[path] = target; }
};
struct LinuxSubject {
    support::ScratchDirectory scratch;
    linux_::Files files{linux_::Root("/")};
    std::string directory = scratch.path();
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

    std::string contents() { return files.read(path, anySize).operator bool() ? *files.read(path, anySize) : "?"; }
    std::size_t entries() const {
        return static_cast<std::size_t>(std::distance(fs::directory_iterator(scratch.path()), {}));
    }
    mode_t mode() const {
        struct stat status{};
        return stat(path.c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
    }
};

} // namespace

TYPED_TEST(FilesConformance, ReadTellsWhatIsWrong) {
    EXPECT_EQ(this->code(this->files.read(this->at("missing"), anySize)), fileReadNoSuchFileCode);
    EXPECT_EQ(this->code(this->files.read(this->subject.directory, anySize)), fileReadUnknownCode);
    ASSERT_FALSE(this->files.writeAtomically(this->at("file"), "12345"));
    EXPECT_EQ(this->code(this->files.read(this->at("file"), 4)), fileReadTooLargeCode);
    EXPECT_EQ(*this->files.read(this->at("file"), 5), "12345");
}

TYPED_TEST(FilesConformance, WriteReplacesTheWhole) {
    for (std::string_view bytes : {std::string_view("long content"), std::string_view("a\0b", 3), std::string_view()}) {
        ASSERT_FALSE(this->files.writeAtomically(this->at("file"), bytes));
        EXPECT_EQ(*this->files.read(this->at("file"), anySize), bytes);
    }
}

TYPED_TEST(FilesConformance, WriteFollowsLinks) {
    this->subject.link(this->at("target"), this->at("link")); // nothing there yet
    for (const char* bytes : {"first", "second"}) {
        ASSERT_FALSE(this->files.writeAtomically(this->at("link"), bytes));
        EXPECT_EQ(*this->files.read(this->at("target"), anySize), bytes);
    }
    EXPECT_EQ(*this->files.realPath(this->at("link"), anySize), this->at("target"));
}

TYPED_TEST(FilesConformance, WriteToWhatIsNoFileFails) {
    EXPECT_EQ(this->files.writeAtomically(this->subject.directory, "x")->code, fileWriteUnknownCode);
    EXPECT_EQ(this->files.writeAtomically(this->at("missing/file"), "x")->code, fileWriteUnknownCode);
}

TYPED_TEST(FilesConformance, RealPathKeepsItsLimit) {
    ASSERT_FALSE(this->files.writeAtomically(this->at("file"), "x"));
    std::string path = this->at("file");
    EXPECT_EQ(*this->files.realPath(path, path.size() + 1), path);
    EXPECT_FALSE(this->files.realPath(path, path.size()));
    EXPECT_EQ(this->code(this->files.realPath(this->at("missing"), anySize)), fileReadNoSuchFileCode);
}

TEST_F(LinuxFiles, ReadRefusesWhatIsNoRegularFile) {
    ASSERT_EQ(mkfifo((scratch / "pipe").c_str(), 0600), 0);
    fs::create_symlink("/dev/zero", scratch / "device");
    for (const char* name : {"pipe", "device"}) {
        auto result = files.read(scratch / name, anySize);
        ASSERT_FALSE(result) << name;
        EXPECT_EQ(result.error().code, fileReadUnknownCode);
        EXPECT_NE(result.error().text().find("not a regular file"), std::string::npos);
    }
    EXPECT_NE(files.read(scratch.path(), anySize).error().text().find("Is a directory"), std::string::npos);
    fs::create_symlink("loop", scratch / "loop");
    EXPECT_EQ(files.read(scratch / "loop", anySize).error().code, fileReadUnknownCode);
}

TEST_F(LinuxFiles, ReadGoesToTheEndOfFilesThatTellNoSize) {
    auto maps = files.read("/proc/self/smaps", anySize * 16); // many pages, said to have no byte
    ASSERT_TRUE(maps);
    EXPECT_NE(maps->rfind("VmFlags:"), std::string::npos);
    EXPECT_GT(maps->rfind("VmFlags:"), 8192U);
    EXPECT_EQ(files.read("/proc/self/smaps", 100).error().code, fileReadTooLargeCode);
}

TEST_F(LinuxFiles, PermissionsAreErrorsOfTheirOwn) {
    ASSERT_FALSE(files.writeAtomically(path, "secret"));
    ASSERT_EQ(chmod(path.c_str(), 0), 0);
    ASSERT_EQ(chmod(scratch.path().c_str(), 0555), 0);
    EXPECT_EQ(support::resultInChild([&] {
                  if (!support::becomeOrdinaryUser()) return 9;
                  auto read = files.read(path, anySize);
                  if (read || read.error().code != fileReadNoPermissionCode) return 1;
                  auto failure = files.writeAtomically(path, "x");
                  return failure && failure->code == fileWriteNoPermissionCode ? 0 : 2;
              }),
              0);
    chmod(scratch.path().c_str(), 0700);
}

TEST_F(LinuxFiles, WriteKeepsModeAndOwner) {
    ASSERT_FALSE(files.writeAtomically(path, "new"));
    EXPECT_EQ(mode(), 0600U);
    ASSERT_EQ(chmod(path.c_str(), 0640), 0);
    const bool privileged = geteuid() == 0;
    ASSERT_TRUE(!privileged || chown(path.c_str(), 12, 34) == 0);
    ASSERT_FALSE(files.writeAtomically(path, "newer"));
    EXPECT_EQ(mode(), 0640U);
    struct stat status{};
    ASSERT_EQ(stat(path.c_str(), &status), 0);
    EXPECT_TRUE(!privileged || (status.st_uid == 12 && status.st_gid == 34));
    EXPECT_EQ(entries(), 1U);
}

TEST_F(LinuxFiles, WriteNeverReplacesADeviceOrFollowsALoop) {
    ASSERT_EQ(mkfifo(path.c_str(), 0600), 0);
    EXPECT_EQ(files.writeAtomically(path, "x")->code, fileWriteUnknownCode);
    EXPECT_TRUE(fs::is_fifo(path));
    fs::create_symlink("loop", scratch / "loop");
    EXPECT_EQ(files.writeAtomically(scratch / "loop", "x")->code, fileWriteUnknownCode);
    EXPECT_EQ(entries(), 2U);
}

TEST_F(LinuxFiles, LongestNameCanBeSaved) {
    path = scratch / std::string(255, 'n');
    EXPECT_FALSE(files.writeAtomically(path, "x"));
    EXPECT_EQ(contents(), "x");
    EXPECT_TRUE(files.writeAtomically(scratch / std::string(256, 'n'), "x"));
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

TEST_F(LinuxFiles, FullDiskLeavesTheOldFileAlone) {
    ASSERT_FALSE(files.writeAtomically(path, "old"));
    const std::string large(100'000, 'x');
    EXPECT_EQ(support::resultInChild([&] {
                  signal(SIGXFSZ, SIG_IGN);
                  rlimit limit{50'000, 50'000};
                  setrlimit(RLIMIT_FSIZE, &limit);
                  auto failure = files.writeAtomically(path, large);
                  return failure && failure->code == fileWriteOutOfSpaceCode ? 0 : 1;
              }),
              0);
    EXPECT_EQ(contents(), "old");
    EXPECT_EQ(entries(), 1U);
}

TEST_F(LinuxFiles, FullFileSystemLeavesTheOldFileAlone) {
    const std::string large(100'000, 'x');
    int result = support::resultInChild([&] {
        if (unshare(CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
            mount("none", scratch.path().c_str(), "tmpfs", 0, "size=64k") != 0)
            return 9;
        if (files.writeAtomically(path, "old")) return 1;
        auto failure = files.writeAtomically(path, large);
        if (!failure || failure->code != fileWriteOutOfSpaceCode) return 2;
        if (contents() != "old" || entries() != 1) return 3;
        return files.writeAtomically(path, "new") ? 4 : 0; // the failed save's space is free again
    });
    if (result == 9) GTEST_SKIP() << "may not mount";
    EXPECT_EQ(result, 0);
}

TEST_F(LinuxFiles, WritersTakeTurns) {
    ASSERT_FALSE(files.writeAtomically(path, std::string(50'000, 'a')));
    std::latch start(3);
    auto writer = [&](char letter) {
        start.arrive_and_wait();
        for (int round = 0; round < 50; ++round) EXPECT_FALSE(files.writeAtomically(path, std::string(50'000, letter)));
    };
    std::thread first(writer, 'a');
    std::thread second(writer, 'b');
    start.arrive_and_wait();
    for (int round = 0; round < 200; ++round) {
        std::string seen = contents();
        EXPECT_EQ(seen, std::string(50'000, seen[0]));
    }
    first.join();
    second.join();
    EXPECT_EQ(entries(), 1U);
}

// Kills a save at each of its system calls in turn, before and after the call.
TEST_F(LinuxFiles, KilledSaveLeavesTheOldOrTheNewFile) {
    const std::string old(10'000, 'o');
    const std::string fresh(20'000, 'n');
    bool finished = false;
    int seenOld = 0;
    int seenNew = 0;
    for (int stops = 1; !finished; ++stops) {
        ASSERT_LT(stops, 1000);
        ASSERT_FALSE(files.writeAtomically(path, old)); // also takes over what the killed one left
        ASSERT_EQ(entries(), 1U);
        pid_t child = fork();
        if (child == 0) {
            if (ptrace(PTRACE_TRACEME, 0, nullptr, nullptr) != 0) _exit(9);
            raise(SIGSTOP);
            _exit(files.writeAtomically(path, fresh) ? 1 : 0);
        }
        int status = 0;
        ASSERT_EQ(waitpid(child, &status, 0), child);
        if (WIFEXITED(status)) GTEST_SKIP() << "may not trace";
        for (int stop = 0; stop < stops && !finished; ++stop) {
            ASSERT_EQ(ptrace(PTRACE_SYSCALL, child, nullptr, nullptr), 0);
            ASSERT_EQ(waitpid(child, &status, 0), child);
            finished = WIFEXITED(status);
        }
        if (finished) {
            EXPECT_EQ(WEXITSTATUS(status), 0);
        } else {
            kill(child, SIGKILL);
            ASSERT_EQ(waitpid(child, &status, 0), child);
        }
        const std::string left = contents();
        ASSERT_TRUE(left == old || left == fresh) << "after " << stops << " stops: " << left.size() << " bytes";
        ++(left == old ? seenOld : seenNew);
        ASSERT_LE(entries(), 2U);
    }
    EXPECT_GT(seenOld, 10); // open, lock, write, sync: each with its two sides
    EXPECT_GT(seenNew, 1);
}
