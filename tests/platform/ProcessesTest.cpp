#include "platform/linux/Processes.h"
#include "platform/linux/CodeSigning.h"
#include "platform/linux/Entitlements.h"
#include "platform/linux/PeerProcess.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ProcessesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <climits>
#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/xattr.h>

using namespace platform;
namespace fs = std::filesystem;

namespace {

constexpr std::size_t anySize = 2048;

/// A token as the transport makes it for a peer that connects now.
AuditToken tokenOf(pid_t pid) { return {pid, getuid(), getgid(), linux_::LinuxPeerProcess::look(pid)}; }

class LinuxProcesses : public testing::Test {
protected:
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

class LinuxCodeSigning : public LinuxProcesses {
protected:
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

TEST(ProcessesConformance, PathFitsWithItsNulOrFails) {
    support::FakeProcesses twin;
    linux_::Processes real;
    const std::string path = fs::read_symlink("/proc/self/exe").string();
    twin.paths[getpid()] = path;
    for (platform::Processes* processes :
         {static_cast<platform::Processes*>(&twin), static_cast<platform::Processes*>(&real)}) {
        const auto expect = [&](const auto& process, const auto& nobody) {
            EXPECT_EQ(*processes->executablePath(process, path.size() + 1), path);
            EXPECT_EQ(processes->executablePath(process, path.size()).error().code, ENAMETOOLONG);
            EXPECT_EQ(processes->executablePath(nobody, anySize).error().code, ESRCH);
        };
        for (const std::int32_t nobody : {-1, 0, INT_MAX}) expect(getpid(), nobody);
        expect(tokenOf(getpid()), AuditToken());
        EXPECT_FALSE(processes->environmentVariable("ZBD_TEST_VARIABLE_THAT_IS_NOT_SET"));
    }
}

TEST_F(LinuxProcesses, PathOfAProcessThatIsGoneIsNobodys) {
    support::WaitingProgram child(program);
    const pid_t pid = child.pid();
    const AuditToken token = tokenOf(pid);
    const int handle = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
    EXPECT_EQ(*processes.executablePath(token, anySize), program);
    kill(pid, SIGKILL);
    siginfo_t ended{};
    ASSERT_EQ(waitid(P_PID, static_cast<id_t>(pid), &ended, WEXITED | WNOWAIT), 0); // a zombie has no program either
    EXPECT_TRUE(pathError(pid) == ESRCH && pathError(token) == ESRCH);
    child.end();
    EXPECT_TRUE(pathError(pid) == ESRCH && pathError(token) == ESRCH);
    // As if the pid had been used again: the number of a living process, the handle of one that has ended.
    EXPECT_FALSE(linux_::LinuxPeerProcess::look(getpid(), linux_::Descriptor(handle)));
}

TEST_F(LinuxProcesses, DeletedAndReplacedProgramsHaveNoPath) {
    const support::WaitingProgram child(program);
    fs::remove(program);
    EXPECT_EQ(pathError(child.pid()), ENOENT);
    const std::string odd = program + " (deleted)"; // the text that the kernel gives names this file now
    install(odd);
    EXPECT_EQ(pathError(child.pid()), ENOENT);
    const support::WaitingProgram oddlyNamed(odd);
    EXPECT_EQ(*processes.executablePath(oddlyNamed.pid(), anySize), odd);
    install(odd);
    EXPECT_EQ(pathError(oddlyNamed.pid()), ENOENT);
    EXPECT_EQ(pathError(tokenOf(oddlyNamed.pid())), ENOENT);
}

TEST_F(LinuxCodeSigning, EntitlementsAreThoseOfTheProgramThatConnected) {
    support::WaitingProgram child(program);
    const auto task = codeSigning.taskFromAuditToken(tokenOf(child.pid()));
    const auto unasked = codeSigning.taskFromAuditToken(tokenOf(child.pid()));
    install(program); // without entitlements; what runs has them
    const support::WaitingProgram unsignedChild(program);
    EXPECT_EQ(codeSigning.copyEntitlement(task, "manager").value, Value(true));
    child.end();
    EXPECT_EQ(codeSigning.copyEntitlement(task, "manager").value, Value(true)) << "read once";
    EXPECT_EQ(codeSigning.copyEntitlement(unasked, "manager").error->code, ESRCH);
    for (const auto& absent : {codeSigning.copyEntitlement(task, "other"), entitlement(unsignedChild.pid())})
        EXPECT_FALSE(absent.value || absent.error);
}

// The trick of connecting as oneself and then becoming a program that has entitlements.
TEST_F(LinuxCodeSigning, AnotherProgramInTheSameProcessLendsNothing) {
    int ends[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    const pid_t child = fork();
    char letter = 0;
    if (child == 0) {
        dup2(ends[1], STDIN_FILENO);
        dup2(ends[1], STDOUT_FILENO);
        if (read(STDIN_FILENO, &letter, 1) == 1) execl(program.c_str(), program.c_str(), nullptr);
        _exit(1);
    }
    close(ends[1]);
    const AuditToken token = tokenOf(child);
    ASSERT_EQ(write(ends[0], "xy", 2), 2);
    ASSERT_EQ(read(ends[0], &letter, 1), 1) << "the program gives back what it is given";
    const auto result = codeSigning.copyEntitlement(codeSigning.taskFromAuditToken(token), "manager");
    EXPECT_TRUE(result.error && !result.value);
    EXPECT_EQ(pathError(token), ESRCH);
    EXPECT_TRUE(entitlement(child).value) << "a connection of its own has them";
    close(ends[0]); // ends the program
    waitpid(child, nullptr, 0);
}

TEST_F(LinuxCodeSigning, BrokenEntitlementsAndUnknownProcessesAreErrors) {
    const support::WaitingProgram child(program);
    const char* name = geteuid() == 0 ? linux_::entitlementsAttribute : linux_::userEntitlementsAttribute;
    for (std::string_view broken : {"", "garbage", "<vlist version=\"1.0\"><array/></vlist>"}) {
        ASSERT_EQ(setxattr(program.c_str(), name, broken.data(), broken.size(), 0), 0);
        const auto result = entitlement(child.pid());
        EXPECT_TRUE(result.error && !result.value) << broken;
    }
    EXPECT_FALSE(codeSigning.taskFromAuditToken({getpid(), getuid(), getgid(), nullptr}));
    EXPECT_TRUE(codeSigning.copyEntitlement(nullptr, "manager").error);
}

TEST_F(LinuxCodeSigning, AttributeIsBelievedOnlyWhereItsSignerVouchesForTheBytes) {
    for (const auto& [mode, believed] : {std::pair(0511U, true), {0775U, false}, {0757U, false}, {0755U, true}}) {
        chmod(program.c_str(), mode);
        EXPECT_EQ(isBelieved(program), believed) << std::oct << mode;
        const bool isWritten = mode != 0511 && !linux_::writeEntitlements(program, manager);
        EXPECT_EQ(isWritten, believed && mode != 0511) << std::oct << mode;
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
