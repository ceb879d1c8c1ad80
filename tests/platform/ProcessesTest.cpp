#include "platform/linux/Processes.h"
#include "platform/linux/CodeSigning.h"
#include "platform/linux/Entitlements.h"
#include "platform/linux/PeerProcess.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ProcessesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <climits>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/xattr.h>

using namespace platform;
namespace fs = std::filesystem;

namespace {

constexpr std::size_t anySize = 2048;

std::string ownPath() { return fs::read_symlink("/proc/self/exe").string(); }

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
        chmod((scratch / "next").c_str(), 0755);
        fs::rename(scratch / "next", path);
    }
    /// errno for the path of a process, 0 when it has one.
    template <class Process> std::int64_t pathError(const Process& process) {
        const auto path = processes.executablePath(process, anySize);
        return path ? 0 : path.error().code;
    }

    support::ScratchDirectory scratch;
    std::string program = scratch / "program";
    linux_::Processes processes;
};

class LinuxCodeSigning : public LinuxProcesses {
protected:
    void SetUp() override {
        auto failure = linux_::writeEntitlements(program, manager);
        if (failure) GTEST_SKIP() << failure->text(); // no privilege, or no attributes here
    }
    std::shared_ptr<SecTask> taskOf(pid_t pid) { return codeSigning.taskFromAuditToken(tokenOf(pid)); }
    bool isBelieved(const std::string& path) {
        auto entitlements = linux_::readEntitlements(path);
        return entitlements && entitlements->has_value();
    }

    linux_::CodeSigning codeSigning;
    const Dictionary manager{{"manager", true}, {"name", "any"}};
};

struct FakeSubject {
    support::FakeProcesses processes;
    FakeSubject() { processes.paths[getpid()] = ownPath(); }
};
struct LinuxSubject {
    linux_::Processes processes;
};
template <class Subject> class ProcessesConformance : public testing::Test {
protected:
    Subject subject;
};
using Subjects = testing::Types<FakeSubject, LinuxSubject>;
TYPED_TEST_SUITE(ProcessesConformance, Subjects);

} // namespace

TYPED_TEST(ProcessesConformance, PathFitsWithItsNulOrFails) {
    platform::Processes& processes = this->subject.processes;
    const std::string path = ownPath();
    const AuditToken token = tokenOf(getpid());
    EXPECT_EQ(*processes.executablePath(getpid(), path.size() + 1), path);
    EXPECT_EQ(*processes.executablePath(token, path.size() + 1), path);
    EXPECT_EQ(processes.executablePath(getpid(), path.size()).error().code, ENAMETOOLONG);
    EXPECT_EQ(processes.executablePath(token, path.size()).error().code, ENAMETOOLONG);
    for (std::int32_t nobody : {-1, 0, INT_MAX})
        EXPECT_EQ(processes.executablePath(nobody, anySize).error().code, ESRCH) << nobody;
    EXPECT_EQ(processes.executablePath(AuditToken(), anySize).error().code, ESRCH);
    EXPECT_FALSE(processes.environmentVariable("ZBD_TEST_VARIABLE_THAT_IS_NOT_SET"));
}

TEST_F(LinuxProcesses, PathOfAProcessThatIsGoneIsNobodys) {
    support::WaitingProgram child(program);
    ASSERT_TRUE(child.runs());
    const pid_t pid = child.pid();
    const AuditToken token = tokenOf(pid);
    EXPECT_EQ(*processes.executablePath(token, anySize), program);
    kill(pid, SIGKILL);
    siginfo_t ended{};
    ASSERT_EQ(waitid(P_PID, static_cast<id_t>(pid), &ended, WEXITED | WNOWAIT), 0); // a zombie has no program either
    EXPECT_EQ(pathError(pid), ESRCH);
    EXPECT_EQ(pathError(token), ESRCH);
    child.end();
    EXPECT_EQ(pathError(pid), ESRCH);
    EXPECT_EQ(pathError(token), ESRCH);
}

TEST_F(LinuxProcesses, TokenDoesNotFitAnotherPid) {
    support::WaitingProgram gone(program);
    support::WaitingProgram other(program);
    // As if the pid had been used again: the number of a living process, the handle of one that has ended.
    int handle = static_cast<int>(syscall(SYS_pidfd_open, gone.pid(), 0));
    gone.end();
    EXPECT_FALSE(linux_::LinuxPeerProcess::look(other.pid(), linux_::Descriptor(handle)));
}

TEST_F(LinuxProcesses, DeletedAndReplacedProgramsHaveNoPath) {
    support::WaitingProgram child(program);
    fs::remove(program);
    EXPECT_EQ(pathError(child.pid()), ENOENT);
    const std::string odd = program + " (deleted)"; // the text that the kernel gives names this file now
    install(odd);
    EXPECT_EQ(pathError(child.pid()), ENOENT);
    support::WaitingProgram oddlyNamed(odd);
    EXPECT_EQ(*processes.executablePath(oddlyNamed.pid(), anySize), odd);
    install(odd);
    EXPECT_EQ(pathError(oddlyNamed.pid()), ENOENT);
    EXPECT_EQ(pathError(tokenOf(oddlyNamed.pid())), ENOENT);
}

TEST_F(LinuxProcesses, MountNamespaceOfItsOwnLendsNoPath) {
    const std::string own = scratch / "own";
    install(own);
    support::WaitingProgram child(program, [&] {
        return unshare(CLONE_NEWNS) == 0 && mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
               mount(own.c_str(), program.c_str(), nullptr, MS_BIND, nullptr) == 0;
    });
    if (!child.runs()) GTEST_SKIP() << "may not mount";
    ASSERT_EQ(fs::read_symlink("/proc/" + std::to_string(child.pid()) + "/exe"), program);
    EXPECT_EQ(pathError(child.pid()), ENOENT);
}

TEST_F(LinuxCodeSigning, EntitlementsAreThoseOfTheProgramThatConnected) {
    support::WaitingProgram child(program);
    auto task = taskOf(child.pid());
    auto unasked = taskOf(child.pid());
    install(program); // without entitlements; what runs has them
    EXPECT_EQ(codeSigning.copyEntitlement(task, "manager").value, Value(true));
    auto absent = codeSigning.copyEntitlement(task, "other");
    EXPECT_FALSE(absent.value || absent.error);
    child.end();
    EXPECT_EQ(codeSigning.copyEntitlement(task, "name").value, Value("any")) << "read once";
    EXPECT_EQ(codeSigning.copyEntitlement(unasked, "name").error->code, ESRCH);
    support::WaitingProgram unsignedChild(program);
    absent = codeSigning.copyEntitlement(taskOf(unsignedChild.pid()), "manager");
    EXPECT_FALSE(absent.value || absent.error);
}

// The trick of connecting as oneself and then becoming a program that has entitlements.
TEST_F(LinuxCodeSigning, AnotherProgramInTheSameProcessLendsNothing) {
    int go[2];
    int became[2]; // closed by the exec
    ASSERT_TRUE(pipe2(go, O_CLOEXEC) == 0 && pipe2(became, O_CLOEXEC) == 0);
    pid_t child = fork();
    if (child == 0) {
        char letter = 0;
        (void)!read(go[0], &letter, 1);
        dup2(go[0], STDIN_FILENO);
        close(go[1]);
        execl(program.c_str(), program.c_str(), nullptr);
        _exit(1);
    }
    const AuditToken token = tokenOf(child);
    auto task = codeSigning.taskFromAuditToken(token);
    ASSERT_EQ(write(go[1], "x", 1), 1);
    close(became[1]);
    char none = 0;
    ASSERT_EQ(read(became[0], &none, 1), 0);
    auto result = codeSigning.copyEntitlement(task, "manager");
    EXPECT_TRUE(result.error && !result.value);
    EXPECT_EQ(pathError(token), ESRCH);
    EXPECT_TRUE(codeSigning.copyEntitlement(taskOf(child), "manager").value) << "a connection of its own has them";
    for (int descriptor : {go[0], go[1], became[0]}) close(descriptor);
    kill(child, SIGKILL);
    waitpid(child, nullptr, 0);
}

TEST_F(LinuxCodeSigning, BrokenEntitlementsAndUnknownProcessesAreErrors) {
    support::WaitingProgram child(program);
    const char* name = geteuid() == 0 ? linux_::entitlementsAttribute : linux_::userEntitlementsAttribute;
    for (std::string_view broken : {"", "garbage", "<vlist version=\"1.0\"><array/></vlist>"}) {
        ASSERT_EQ(setxattr(program.c_str(), name, broken.data(), broken.size(), 0), 0);
        auto result = codeSigning.copyEntitlement(taskOf(child.pid()), "manager");
        EXPECT_TRUE(result.error && !result.value) << broken;
    }
    EXPECT_FALSE(codeSigning.taskFromAuditToken({getpid(), getuid(), getgid(), nullptr}));
    EXPECT_TRUE(codeSigning.copyEntitlement(nullptr, "manager").error);
}

TEST_F(LinuxCodeSigning, AttributeIsBelievedOnlyWhereItsSignerVouchesForTheBytes) {
    const bool isRoot = geteuid() == 0;
    const std::pair<mode_t, bool> modes[] = {{0511, true}, {0775, false}, {0757, false}, {0722, false}, {0755, true}};
    for (const auto& [mode, believed] : modes) {
        ASSERT_EQ(chmod(program.c_str(), mode), 0);
        EXPECT_EQ(isBelieved(program), believed) << std::oct << mode;
        if (mode == 0511 && !isRoot) continue; // to be read, not to be signed anew
        EXPECT_EQ(!linux_::writeEntitlements(program, manager), believed) << std::oct << mode;
    }
    // Copies, as anybody can make them, carry nothing.
    const std::string copy = scratch / "copy";
    fs::copy_file(program, copy);
    EXPECT_FALSE(isBelieved(copy));
    if (!isRoot) return;

    // root's daemon: not another user's file, not the attribute that its owner can write. One user's daemon: that
    // attribute, on that user's files alone, and what root signed.
    const auto isBelievedByUser = [&](const std::string& path) {
        return support::resultInChild([&] { return support::becomeOrdinaryUser() ? int{isBelieved(path)} : 9; });
    };
    ASSERT_EQ(chown(program.c_str(), support::ordinaryUser, 0), 0);
    EXPECT_FALSE(isBelieved(program));
    EXPECT_EQ(isBelievedByUser(program), 1);
    const std::string bytes = *encodeXML(Value(manager));
    ASSERT_EQ(setxattr(copy.c_str(), linux_::userEntitlementsAttribute, bytes.data(), bytes.size(), 0), 0);
    EXPECT_FALSE(isBelieved(copy));
    EXPECT_EQ(isBelievedByUser(copy), 0);
    ASSERT_EQ(setxattr(copy.c_str(), linux_::entitlementsAttribute, bytes.data(), bytes.size(), 0), 0);
    EXPECT_EQ(isBelievedByUser(copy), 1);
}

// A stick or a FUSE file system that a user may mount claims any owner and any attribute.
TEST_F(LinuxCodeSigning, FileSystemWithoutPrivilegesLendsNone) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    const char* directory = scratch.path().c_str();
    int result = support::resultInChild([&] {
        if (unshare(CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
            mount(directory, directory, nullptr, MS_BIND, nullptr) != 0 || !isBelieved(program) ||
            mount("none", directory, nullptr, MS_REMOUNT | MS_BIND | MS_NOSUID, nullptr) != 0)
            return 9;
        return int{isBelieved(program)};
    });
    if (result == 9) GTEST_SKIP() << "may not mount";
    EXPECT_EQ(result, 0);
}
