#include "platform/linux/Processes.h"
#include "platform/linux/CodeSigning.h"
#include "platform/linux/Entitlements.h"
#include "platform/linux/PeerProcess.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ScratchDirectory.h"

#include <fstream>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/xattr.h>

using namespace platform;
using support::WaitingProgram;
namespace fs = std::filesystem;

namespace {

constexpr std::size_t anySize = 2048;

/// A token as the transport makes it for a peer that connects now.
AuditToken tokenOf(pid_t pid) { return {pid, getuid(), getgid(), linux_::LinuxPeerProcess::look(pid)}; }

struct LinuxProcesses : testing::Test {
    LinuxProcesses() {
        chmod(scratch.path().c_str(), 0755);
        install(program);
    }
    /// As an installer does: replaces by another file at the same path.
    void install(const std::string& path) {
        fs::copy_file("/bin/cat", scratch / "next");
        fs::rename(scratch / "next", path);
    }
    /// errno for the path of a process, 0 when it has one.
    std::int64_t pathError(const auto& process) {
        const auto path = processes.executablePath(process, anySize);
        return path ? 0 : path.error().code;
    }

    support::ScratchDirectory scratch;
    const std::string program = scratch / "program";
    linux_::Processes processes;
};

struct LinuxCodeSigning : LinuxProcesses {
    void SetUp() override {
        if (const auto failure = linux_::writeEntitlements(program, manager))
            GTEST_SKIP() << failure->text(); // no privilege, or no attributes here
    }
    EntitlementValue entitlement(pid_t pid) {
        return codeSigning.copyEntitlement(codeSigning.taskFromAuditToken(tokenOf(pid)), "manager");
    }
    static bool isBelieved(const std::string& path) {
        const auto entitlements = linux_::readEntitlements(path);
        return entitlements && entitlements->has_value();
    }

    linux_::CodeSigning codeSigning;
    const Dictionary manager{{"manager", true}};
};

TEST_F(LinuxProcesses, PathIsThatOfTheLivingProcessAndFits) {
    WaitingProgram child(program);
    const pid_t pid = child.pid();
    const AuditToken token = tokenOf(pid);
    const int handle = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
    EXPECT_EQ(*processes.executablePath(pid, program.size() + 1), program);
    EXPECT_EQ(processes.executablePath(token, program.size()).error().code, ENAMETOOLONG) << "with its NUL";
    child.end();
    EXPECT_TRUE(pathError(pid) == ESRCH && pathError(token) == ESRCH);
    EXPECT_TRUE(pathError(0) == ESRCH && pathError(AuditToken()) == ESRCH);
    // As if the pid had been used again: the number of a living process, the handle of one that has ended.
    EXPECT_FALSE(linux_::LinuxPeerProcess::look(getpid(), linux_::Descriptor(handle)));
}

TEST_F(LinuxProcesses, DeletedAndReplacedProgramsHaveNoPath) {
    const WaitingProgram child(program);
    const AuditToken token = tokenOf(child.pid());
    const std::function<void()> changes[] = {
        [&] { install(program); }, [&] { fs::remove(program); },
        [&] { install(program + " (deleted)"); }, // the text that the kernel gives names this file now
    };
    for (const auto& change : changes) {
        change();
        EXPECT_TRUE(pathError(child.pid()) == ENOENT && pathError(token) == ENOENT);
    }
}

TEST_F(LinuxCodeSigning, EntitlementsAreThoseOfTheProgramThatConnected) {
    WaitingProgram child(program);
    const auto task = codeSigning.taskFromAuditToken(tokenOf(child.pid()));
    const auto unasked = codeSigning.taskFromAuditToken(tokenOf(child.pid()));
    install(program); // without entitlements; what runs has them
    const WaitingProgram unsignedChild(program);
    EXPECT_EQ(codeSigning.copyEntitlement(task, "manager").value, Value(true));
    child.end();
    EXPECT_EQ(codeSigning.copyEntitlement(task, "manager").value, Value(true)) << "read once";
    EXPECT_EQ(codeSigning.copyEntitlement(unasked, "manager").error->code, ESRCH);
    EXPECT_TRUE(codeSigning.copyEntitlement(codeSigning.taskFromAuditToken(AuditToken()), "manager").error);
    for (const auto& absent : {codeSigning.copyEntitlement(task, "other"), entitlement(unsignedChild.pid())})
        EXPECT_FALSE(absent.value || absent.error);
}

// The trick of connecting as oneself and then becoming a program that has entitlements.
TEST_F(LinuxCodeSigning, AnotherProgramInTheSameProcessLendsNothing) {
    for (const char* gate : {"first", "second"}) mkfifo((scratch / gate).c_str(), 0600);
    const WaitingProgram child("/bin/sh", support::atOnce,
                               {"-c", "cd " + scratch.path() + "; read go <first; exec ./program second"});
    const AuditToken token = tokenOf(child.pid());
    std::ofstream(scratch / "first") << "\n";
    const std::ofstream opensWithTheProgram(scratch / "second");
    const auto result = codeSigning.copyEntitlement(codeSigning.taskFromAuditToken(token), "manager");
    EXPECT_TRUE(result.error && !result.value);
    EXPECT_EQ(pathError(token), ESRCH);
    EXPECT_TRUE(entitlement(child.pid()).value) << "a connection of its own has them";
}

TEST_F(LinuxCodeSigning, AttributeIsBelievedOnlyWhereItsSignerVouchesForTheBytes) {
    for (const auto& [mode, believed] : {std::pair(0775U, false), {0757U, false}, {0755U, true}}) {
        chmod(program.c_str(), mode);
        EXPECT_EQ(isBelieved(program), believed) << std::oct << mode;
        EXPECT_NE(linux_::writeEntitlements(program, manager).has_value(), believed) << std::oct << mode;
    }
    // Copies, as anybody can make them, carry nothing.
    const std::string copy = scratch / "copy";
    fs::copy_file(program, copy);
    EXPECT_FALSE(isBelieved(copy));
    if (geteuid() != 0) return;

    // root's daemon: not another user's file, not the attribute that its owner can write. One user's daemon: that
    // attribute, on that user's files alone, and what root signed.
    const auto isBelievedByUser = [&](const std::string& path) {
        return support::resultInChild([&] { return support::becomeOrdinaryUser() ? int{isBelieved(path)} : 9; });
    };
    ASSERT_EQ(chown(program.c_str(), support::ordinaryUser, 0), 0);
    EXPECT_FALSE(isBelieved(program));
    EXPECT_EQ(isBelievedByUser(program), 1);
    const std::string bytes = *encodeXML(Value(manager));
    for (const auto& [name, believed] :
         {std::pair(linux_::userEntitlementsAttribute, false), {linux_::entitlementsAttribute, true}}) {
        ASSERT_EQ(setxattr(copy.c_str(), name, bytes.data(), bytes.size(), 0), 0);
        EXPECT_EQ(isBelieved(copy), believed) << name;
        EXPECT_EQ(isBelievedByUser(copy), int{believed}) << name;
    }
}

// A stick or a FUSE file system that a user may mount claims any owner and any attribute.
TEST_F(LinuxCodeSigning, FileSystemWithoutPrivilegesLendsNone) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    const char* directory = scratch.path().c_str();
    const int result = support::resultInChild([&] {
        if (unshare(CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
            mount(directory, directory, nullptr, MS_BIND, nullptr) != 0 || !isBelieved(program) ||
            mount("none", directory, nullptr, MS_REMOUNT | MS_BIND | MS_NOSUID, nullptr) != 0)
            return 9;
        return int{isBelieved(program)};
    });
    if (result == 9) GTEST_SKIP() << "may not mount";
    EXPECT_EQ(result, 0);
}

} // namespace
