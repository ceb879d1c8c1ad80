#include "platform/linux/Processes.h"
#include "platform/linux/CodeSigning.h"
#include "platform/linux/Entitlements.h"
#include "platform/linux/PeerProcess.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/CodeSigningFake.h"
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

class ProgramTest : public testing::Test {
protected:
    ProgramTest() {
        chmod(scratch.path().c_str(), 0755);
        fs::copy_file("/bin/cat", program);
        chmod(program.c_str(), 0755);
    }
    /// Replaces as an installer does: by another file at the same path.
    void replaceProgram() {
        fs::copy_file("/bin/cat", scratch / "next");
        fs::rename(scratch / "next", program);
    }

    support::ScratchDirectory scratch;
    std::string program = scratch / "program";
};

class LinuxProcesses : public ProgramTest {
protected:
    std::int64_t errorOf(const Result<std::string>& result) { return result ? 0 : result.error().code; }
    linux_::Processes processes;
};

class LinuxCodeSigning : public ProgramTest {
protected:
    void sign(const Dictionary& entitlements) {
        auto failure = linux_::writeEntitlements(program, entitlements);
        if (failure) GTEST_SKIP() << failure->text(); // no privilege, or no attributes here
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
    EXPECT_EQ(errorOf(processes.executablePath(pid, anySize)), ESRCH);
    EXPECT_EQ(errorOf(processes.executablePath(token, anySize)), ESRCH);
    child.end();
    EXPECT_EQ(errorOf(processes.executablePath(pid, anySize)), ESRCH);
    EXPECT_EQ(errorOf(processes.executablePath(token, anySize)), ESRCH);
}

TEST_F(LinuxProcesses, TokenDoesNotFitAnotherPid) {
    support::WaitingProgram gone(program);
    support::WaitingProgram other(program);
    ASSERT_TRUE(gone.runs() && other.runs());
    // As if the pid had been used again: the number of a living process, the handle of one that has ended.
    int handle = static_cast<int>(syscall(SYS_pidfd_open, gone.pid(), 0));
    gone.end();
    EXPECT_FALSE(linux_::LinuxPeerProcess::look(other.pid(), linux_::Descriptor(handle)));
}

TEST_F(LinuxProcesses, DeletedAndReplacedProgramsHaveNoPath) {
    support::WaitingProgram child(program);
    ASSERT_TRUE(child.runs());
    fs::remove(program);
    EXPECT_EQ(errorOf(processes.executablePath(child.pid(), anySize)), ENOENT);
    fs::copy_file("/bin/cat", program + " (deleted)"); // the text that the kernel gives names this file now
    EXPECT_EQ(errorOf(processes.executablePath(child.pid(), anySize)), ENOENT);
    support::WaitingProgram oddlyNamed(program + " (deleted)");
    ASSERT_TRUE(oddlyNamed.runs());
    EXPECT_EQ(*processes.executablePath(oddlyNamed.pid(), anySize), program + " (deleted)");

    fs::copy_file("/bin/cat", program);
    support::WaitingProgram outdated(program);
    ASSERT_TRUE(outdated.runs());
    replaceProgram();
    EXPECT_EQ(errorOf(processes.executablePath(outdated.pid(), anySize)), ENOENT);
    EXPECT_EQ(errorOf(processes.executablePath(tokenOf(outdated.pid()), anySize)), ENOENT);
}

TEST_F(LinuxProcesses, MountNamespaceOfItsOwnLendsNoPath) {
    const std::string own = scratch / "own";
    fs::copy_file("/bin/cat", own);
    support::WaitingProgram child(program, [&] {
        return unshare(CLONE_NEWNS) == 0 && mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
               mount(own.c_str(), program.c_str(), nullptr, MS_BIND, nullptr) == 0;
    });
    if (!child.runs()) GTEST_SKIP() << "may not mount";
    ASSERT_EQ(fs::read_symlink("/proc/" + std::to_string(child.pid()) + "/exe"), program);
    EXPECT_EQ(errorOf(processes.executablePath(child.pid(), anySize)), ENOENT);
}

TEST_F(LinuxCodeSigning, EntitlementsAreThoseOfTheProgramThatConnected) {
    sign(manager);
    if (IsSkipped()) return;
    support::WaitingProgram child(program);
    ASSERT_TRUE(child.runs());
    auto task = codeSigning.taskFromAuditToken(tokenOf(child.pid()));
    ASSERT_TRUE(task);
    replaceProgram(); // without entitlements; what runs has them
    EXPECT_EQ(codeSigning.copyEntitlement(task, "manager").value, Value(true));
    auto absent = codeSigning.copyEntitlement(task, "other");
    EXPECT_FALSE(absent.value || absent.error);
    child.end();
    EXPECT_EQ(codeSigning.copyEntitlement(task, "name").value, Value("any")) << "read once";
}

TEST_F(LinuxCodeSigning, ProcessGoneBeforeTheFirstQueryIsAnError) {
    sign(manager);
    if (IsSkipped()) return;
    support::WaitingProgram child(program);
    ASSERT_TRUE(child.runs());
    auto task = codeSigning.taskFromAuditToken(tokenOf(child.pid()));
    child.end();
    auto result = codeSigning.copyEntitlement(task, "manager");
    EXPECT_FALSE(result.value);
    ASSERT_TRUE(result.error);
    EXPECT_EQ(result.error->code, ESRCH);
}

// The trick of connecting as oneself and then becoming a program that has entitlements.
TEST_F(LinuxCodeSigning, AnotherProgramInTheSameProcessLendsNothing) {
    sign(manager);
    if (IsSkipped()) return;
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
    close(became[0]);
    auto result = codeSigning.copyEntitlement(task, "manager");
    EXPECT_FALSE(result.value);
    EXPECT_TRUE(result.error);
    EXPECT_EQ(linux_::Processes().executablePath(token, anySize).error().code, ESRCH);
    // A connection of its own has them.
    EXPECT_TRUE(codeSigning.copyEntitlement(codeSigning.taskFromAuditToken(tokenOf(child)), "manager").value);
    close(go[0]);
    close(go[1]);
    kill(child, SIGKILL);
    waitpid(child, nullptr, 0);
}

TEST_F(LinuxCodeSigning, NoEntitlementsIsNoErrorButBrokenOnesAre) {
    support::WaitingProgram child(program);
    ASSERT_TRUE(child.runs());
    auto plain = codeSigning.copyEntitlement(codeSigning.taskFromAuditToken(tokenOf(child.pid())), "manager");
    EXPECT_FALSE(plain.value || plain.error);
    sign(manager);
    if (IsSkipped()) return;
    const char* name = geteuid() == 0 ? linux_::entitlementsAttribute : linux_::userEntitlementsAttribute;
    for (std::string_view broken : {"", "garbage", "<vlist version=\"1.0\"><array/></vlist>"}) {
        ASSERT_EQ(setxattr(program.c_str(), name, broken.data(), broken.size(), 0), 0);
        auto result = codeSigning.copyEntitlement(codeSigning.taskFromAuditToken(tokenOf(child.pid())), "manager");
        EXPECT_FALSE(result.value) << broken;
        EXPECT_TRUE(result.error) << broken;
    }
}

TEST_F(LinuxCodeSigning, WithoutAnIdentifiedProcessThereIsNoTask) {
    EXPECT_FALSE(codeSigning.taskFromAuditToken({getpid(), getuid(), getgid(), nullptr}));
    auto result = codeSigning.copyEntitlement(nullptr, "manager");
    EXPECT_FALSE(result.value);
    EXPECT_TRUE(result.error);
    support::FakeCodeSigning fake;
    auto task = fake.taskFromAuditToken({1, 0, 0, nullptr});
    EXPECT_FALSE(fake.copyEntitlement(task, "manager").value) << "the twin grants nothing by itself";
}

TEST_F(LinuxCodeSigning, AttributeIsBelievedOnlyWhereItsSignerVouchesForTheBytes) {
    sign(manager);
    if (IsSkipped()) return;
    const uid_t self = geteuid();
    const struct {
        mode_t mode;
        bool believed;
    } modes[] = {{0755, true}, {0511, true}, {0700, true}, {0775, false}, {0757, false}, {0722, false}};
    for (const auto& [mode, believed] : modes) {
        ASSERT_EQ(chmod(program.c_str(), mode), 0);
        auto result = linux_::readEntitlements(program);
        ASSERT_TRUE(result) << result.error().text();
        EXPECT_EQ(result->has_value(), believed) << std::oct << mode;
        if (mode == 0511 && self != 0) continue; // to be read, not to be signed anew
        EXPECT_EQ(!linux_::writeEntitlements(program, manager), believed) << std::oct << mode;
    }
    chmod(program.c_str(), 0755);
    // Copies, as anybody can make them, carry nothing.
    fs::copy_file(program, scratch / "copy");
    EXPECT_FALSE(linux_::readEntitlements(scratch / "copy")->has_value());
    if (self != 0) return;

    // root's daemon: not another user's file, not the attribute that its owner can write.
    ASSERT_EQ(chown(program.c_str(), support::ordinaryUser, 0), 0);
    EXPECT_FALSE(linux_::readEntitlements(program)->has_value());
    const std::string bytes = *encodeXML(Value(manager));
    const std::string copy = scratch / "copy";
    ASSERT_EQ(setxattr(copy.c_str(), linux_::userEntitlementsAttribute, bytes.data(), bytes.size(), 0), 0);
    EXPECT_FALSE(linux_::readEntitlements(copy)->has_value());

    // One user's daemon: the same attribute, on that user's files alone, and what root signed.
    EXPECT_EQ(support::resultInChild([&] {
                  if (!support::becomeOrdinaryUser()) return 9;
                  auto foreign = linux_::readEntitlements(copy);
                  if (!foreign || foreign->has_value()) return 1;
                  auto own = linux_::readEntitlements(program);
                  return own && own->has_value() ? 0 : 2;
              }),
              0);
    ASSERT_EQ(setxattr(copy.c_str(), linux_::entitlementsAttribute, bytes.data(), bytes.size(), 0), 0);
    EXPECT_EQ(support::resultInChild([&] {
                  if (!support::becomeOrdinaryUser()) return 9;
                  auto signedByRoot = linux_::readEntitlements(copy);
                  return signedByRoot && signedByRoot->has_value() ? 0 : 1;
              }),
              0);
}

// A stick or a FUSE file system that a user may mount claims any owner and any attribute.
TEST_F(LinuxCodeSigning, FileSystemWithoutPrivilegesLendsNone) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    sign(manager);
    if (IsSkipped()) return;
    int result = support::resultInChild([&] {
        const char* directory = scratch.path().c_str();
        if (unshare(CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
            mount(directory, directory, nullptr, MS_BIND, nullptr) != 0)
            return 9;
        auto ordinary = linux_::readEntitlements(program);
        if (mount("none", directory, nullptr, MS_REMOUNT | MS_BIND | MS_NOSUID, nullptr) != 0) return 9;
        auto nosuid = linux_::readEntitlements(program);
        return ordinary && ordinary->has_value() && nosuid && !nosuid->has_value() ? 0 : 1;
    });
    if (result == 9) GTEST_SKIP() << "may not mount";
    EXPECT_EQ(result, 0);
}
