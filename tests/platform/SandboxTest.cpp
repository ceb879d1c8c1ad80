#include "platform/linux/Sandbox.h"
#include "platform/linux/ConfinementProfiles.h"
#include "platform/linux/SandboxBroker.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/SandboxFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <climits>
#include <fstream>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>

using namespace platform;
namespace fs = std::filesystem;

namespace {

constexpr const char* serviceClass = "com.nordane.zembra.plugin-service";

std::string contentsOf(int descriptor) {
    char bytes[64];
    const ssize_t size = pread(descriptor, bytes, sizeof bytes, 0);
    return size < 0 ? "?" : std::string(bytes, static_cast<std::size_t>(size));
}
std::string contentsAt(int directory, const std::string& name) {
    return contentsOf(linux_::Descriptor(openat(directory, name.c_str(), O_RDONLY | O_CLOEXEC)).get());
}

/// Two bundles with a resource each, the second's name beginning like the first's: `Bundle/Font`, `Bundle2/Font`.
template <bool isServed> struct OnLinux {
    support::ScratchDirectory scratch;
    linux_::Sandbox issuer{linux_::Root(scratch.path()), linux_::SandboxRole::issuer};
    linux_::Sandbox host{linux_::Root(scratch.path()), linux_::SandboxRole::consumer};
    std::string directory = scratch.path();

    OnLinux() {
        chmod(directory.c_str(), 0755);
        for (const std::string bundle : {"Bundle", "Bundle2"}) {
            fs::create_directory(scratch / bundle);
            std::ofstream(scratch / bundle + "/Font") << bundle;
        }
        EXPECT_FALSE(isServed && issuer.startBroker());
    }
};
struct InMemory {
    support::FakeSandbox issuer;
    support::FakeSandbox& host = issuer;
    std::string directory = "/scratch";

    InMemory() {
        for (const char* name : {"/Bundle", "/Bundle/Font", "/Bundle2/Font"}) issuer.allowFile(directory + name);
        issuer.services.insert("any.service");
    }
};

template <class Subject> class SandboxConformance : public testing::Test {
protected:
    Subject subject;
    platform::Sandbox& issuer = subject.issuer;
    platform::Sandbox& host = subject.host;
    std::string at(const std::string& name) { return subject.directory + "/" + name; }
    Result<std::string> issue(const std::string& name, const std::string& within = "") {
        return issuer.issueFile(sandboxReadExtensionClass, at(name), SandboxFlag::canonical, within);
    }
    static std::int64_t errorOf(const auto& result) { return result ? 0 : result.error().code; }
    /// errno of consuming, 0 for success; the right is given back at once.
    int consumeError(const std::string& token) {
        int number = 0;
        const auto handle = host.consume(token, number);
        return handle < 0 ? number : host.release(handle, number);
    }
    /// The right to what the token is for, kept until the test ends.
    std::int64_t consumed(const std::string& token) {
        int number = 0;
        const auto handle = host.consume(token, number);
        EXPECT_GE(handle, 0) << number;
        return handle;
    }
    int descriptorOf(const std::string& token) { return subject.host.descriptor(consumed(token)); }
};
using Subjects = testing::Types<InMemory, OnLinux<true>>;
TYPED_TEST_SUITE(SandboxConformance, Subjects);
using LinuxSandbox = SandboxConformance<OnLinux<true>>;

/// The broker is another process, so that this one has no threads and its children may do anything.
class SandboxPeers : public SandboxConformance<OnLinux<false>> {
protected:
    ~SandboxPeers() override { killBroker(); }
    void startBroker(const support::Preparation& prepare = support::atOnce) {
        _broker = support::startChild([&] { return !prepare() || subject.issuer.startBroker() ? 1 : pause(); });
        while (consumeError("x") != EPERM) ASSERT_EQ(waitpid(_broker, nullptr, WNOHANG), 0);
    }
    void killBroker() {
        if (_broker == 0) return;
        kill(_broker, SIGKILL);
        support::waitFor(std::exchange(_broker, 0));
    }
    static constexpr int cannot = 99;
    int errorOfPeer(const std::string& token, const support::Preparation& prepare) {
        return support::resultInChild([&] { return prepare() ? consumeError(token) : cannot; });
    }

private:
    pid_t _broker = 0;
};

} // namespace

TYPED_TEST(SandboxConformance, TokenIsConsumedAndReleased) {
    auto file = this->issue("Bundle/Font", this->at("Bundle"));
    auto service = this->issuer.issueService(serviceClass, "any.service");
    ASSERT_TRUE(file && service);
    for (const auto& token : {*file, *service}) {
        int number = 0;
        const auto first = this->consumed(token);
        const auto second = this->consumed(token);
        EXPECT_NE(first, second);
        EXPECT_EQ(this->host.release(first, number), 0);
        EXPECT_NE(this->host.release(first, number), 0);
        EXPECT_EQ(number, EINVAL);
        EXPECT_EQ(this->host.release(second, number), 0);
    }
}

TYPED_TEST(SandboxConformance, RefusesWhatIsNotWithinAndWhatWasNotIssued) {
    EXPECT_TRUE(this->issue("Bundle", this->at("Bundle")));
    EXPECT_EQ(this->errorOf(this->issue("Bundle2/Font", this->at("Bundle"))), EPERM);
    EXPECT_EQ(this->consumeError("x"), EPERM);
    EXPECT_EQ(this->consumeError(""), EINVAL);
}

TEST_F(LinuxSandbox, IssueTellsWhyNot) {
    fs::create_symlink("../Bundle2/Font", at("Bundle/leaving"));
    ASSERT_EQ(mkfifo(at("Bundle/pipe").c_str(), 0600), 0);
    const std::string bundle = at("Bundle");
    const std::tuple<std::string, std::string, int> cases[] = {
        {"missing", "", ENOENT},
        {"Bundle/Font", at("missing"), ENOENT},
        {"Bundle/leaving", bundle, EPERM},
        {"Bundle/../Bundle2/Font", bundle, EPERM},
        {"Bundle/..", bundle, EPERM},
        {"Bundle/pipe", bundle, EINVAL},
        {std::string("Bundle/Font\0x", 13), "", EINVAL},
    };
    for (const auto& [name, within, number] : cases)
        for (const char* time : {"first", "again"})
            EXPECT_EQ(errorOf(issue(name, within)), number) << time << ": " << name.substr(0, 40);
    EXPECT_EQ(errorOf(issuer.issueFile(sandboxReadExtensionClass, "Bundle", SandboxFlag::canonical, "")), EINVAL);
    EXPECT_EQ(errorOf(issuer.issueService(serviceClass, std::string(256, 'n'))), EINVAL);
    EXPECT_EQ(errorOf(issuer.issueService("", "name")), EINVAL);
    EXPECT_EQ(errorOf(host.issueService(serviceClass, "name")), EPERM);
    EXPECT_EQ(errorOf(host.issueFile(sandboxReadExtensionClass, bundle, SandboxFlag::none, "")), EPERM);
}

TEST_F(LinuxSandbox, ConsumedFileIsReadable) {
    const std::string odd = "Bundle/%41;\n\xff ";
    std::ofstream(at(odd)) << "Bundle";
    fs::create_symlink(at("Bundle/Font"), at("Bundle/alias"));
    for (const SandboxFlag flag : {SandboxFlag::canonical, SandboxFlag::none})
        for (const std::string& name : {std::string("Bundle/Font"), std::string("Bundle/alias"), odd}) {
            const auto token = *issuer.issueFile(sandboxReadExtensionClass, at(name), flag, at("Bundle"));
            for (const char byte : token) EXPECT_TRUE(byte > ' ' && byte < 0x7f) << token;
            const auto handle = consumed(token);
            const int descriptor = subject.host.descriptor(handle);
            EXPECT_EQ(contentsOf(descriptor), "Bundle") << name;
            EXPECT_EQ(fcntl(descriptor, F_GETFL) & O_ACCMODE, O_RDONLY);
            EXPECT_EQ(fcntl(descriptor, F_GETFD), FD_CLOEXEC);
            int number = 0;
            EXPECT_EQ(host.release(handle, number), 0);
            EXPECT_EQ(fcntl(descriptor, F_GETFD), -1) << "still open";
            EXPECT_EQ(subject.host.descriptor(handle), -1);
        }
    EXPECT_EQ(descriptorOf(*issuer.issueService(serviceClass, "name")), -1) << "nothing to read";
}

TEST_F(LinuxSandbox, DirectoryOpensWhatIsBelowAlone) {
    fs::create_symlink(at("Bundle2"), at("Bundle/leaving"));
    fs::create_directory(at("Bundle/folder"));
    const auto bundle = consumed(*issue("Bundle"));
    const auto font = consumed(*issue("Bundle/Font"));
    const auto released = consumed(*issue("Bundle"));
    int number = 0;
    host.release(released, number);
    const std::tuple<std::int64_t, std::string, int> cases[] = {
        {bundle, "Font", 0},
        {bundle, "../Bundle2/Font", EXDEV},
        {bundle, at("Bundle2/Font"), EXDEV},
        {bundle, "leaving/Font", EXDEV},
        {bundle, "missing", ENOENT},
        {bundle, "folder", EISDIR},
        {bundle, "", EINVAL},
        {bundle, std::string(PATH_MAX, 'x'), EINVAL},
        {font, "Font", ENOTDIR},
        {released, "Font", EINVAL},
    };
    for (const auto& [handle, path, error] : cases)
        EXPECT_EQ(errorOf(subject.host.open(handle, path)), error) << path.substr(0, 40);
}

TEST_F(LinuxSandbox, ReadingGivesNoWayToWriteNorUpwards) {
    const auto bundle = consumed(*issue("Bundle"));
    const int directory = subject.host.descriptor(bundle);
    EXPECT_EQ(contentsAt(directory, "Font"), "Bundle");
    if (!linux_::Descriptor(open_tree(AT_FDCWD, "/", OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC)))
        GTEST_SKIP() << "may not copy mounts";
    EXPECT_EQ(contentsAt(directory, "../Bundle2/Font"), "?");
    const auto opened = subject.host.open(bundle, "Font");
    const linux_::Descriptor below(openat(directory, "Font", O_RDONLY | O_CLOEXEC));
    for (const int file : {descriptorOf(*issue("Bundle/Font")), opened->get(), below.get()}) {
        const std::string again = "/proc/self/fd/" + std::to_string(file);
        EXPECT_EQ(contentsAt(AT_FDCWD, again), "Bundle");
        EXPECT_FALSE(linux_::Descriptor(open(again.c_str(), O_RDWR | O_CLOEXEC)));
        EXPECT_EQ(errno, EROFS);
        EXPECT_NE(fchmod(file, 0666), 0);
    }
}

TEST_F(LinuxSandbox, AlteredTokensAreRefused) {
    const std::string token = *issue("Bundle/Font");
    ASSERT_EQ(consumeError(token), 0);
    for (std::size_t index = 0; index < token.size(); ++index) {
        for (const int difference : {1, 0x20}) { // 0x20: the other case
            std::string altered = token;
            altered[index] = static_cast<char>(token[index] ^ difference);
            EXPECT_EQ(consumeError(altered), EPERM) << index;
        }
        EXPECT_EQ(consumeError(token.substr(0, index)), index == 0 ? EINVAL : EPERM) << index;
    }
    EXPECT_EQ(consumeError(token + "0"), EPERM);
    EXPECT_EQ(consumeError(std::string(linux_::maximumTokenSize, 'x')), EPERM);
    EXPECT_EQ(consumeError(std::string(linux_::maximumTokenSize + 1, 'x')), EINVAL);
    linux_::Sandbox stranger(linux_::Root(subject.directory), linux_::SandboxRole::issuer);
    auto foreign = stranger.issueFile(sandboxReadExtensionClass, at("Bundle/Font"), SandboxFlag::canonical, "");
    EXPECT_EQ(consumeError(*foreign), EPERM);
}

TEST_F(LinuxSandbox, TokenIsForWhatWasThereThen) {
    const auto replaced = *issue("Bundle/Font");
    const auto moved = *issue("Bundle2/Font");
    fs::rename(at("Bundle"), at("Old"));
    EXPECT_EQ(consumeError(replaced), ENOENT);
    fs::create_directory(at("Bundle"));
    std::ofstream(at("Bundle/Font")) << "new";
    EXPECT_EQ(consumeError(replaced), ESTALE);

    // The same file by way of a link is not the path that was checked.
    fs::rename(at("Bundle2"), at("Elsewhere"));
    fs::create_directory_symlink(at("Elsewhere"), at("Bundle2"));
    EXPECT_EQ(consumeError(moved), ELOOP);

    // A link that led into the bundle leads elsewhere now.
    fs::create_symlink("Font", at("Bundle/alias"));
    ASSERT_TRUE(issue("Bundle/alias", at("Bundle")));
    fs::remove(at("Bundle/alias"));
    fs::create_symlink(at("Elsewhere/Font"), at("Bundle/alias"));
    EXPECT_EQ(errorOf(issue("Bundle/alias", at("Bundle"))), EPERM);
    EXPECT_EQ(contentsOf(descriptorOf(*issue("Bundle/alias"))), "Bundle2");

    // Inode numbers are used again.
    for (int round = 0; round < 20; ++round) {
        const auto token = *issue("Bundle/Font");
        fs::remove(at("Bundle/Font"));
        std::ofstream(at("Bundle/Font")) << "other";
        EXPECT_EQ(consumeError(token), ESTALE);
    }
}

TEST_F(LinuxSandbox, KeptTokenGivesWayToThatOfWhatIsThereNow) {
    const auto kept = *issue("Bundle/Font");
    for (int time = 0; time < 3; ++time) EXPECT_EQ(*issue("Bundle/Font"), kept);
    fs::remove(at("Bundle/Font"));
    std::ofstream(at("Bundle/Font")) << "other";
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (consumeError(*issue("Bundle/Font")) != 0) ASSERT_LT(std::chrono::steady_clock::now(), deadline);
    fs::remove(at("Bundle/Font"));
    while (issue("Bundle/Font")) ASSERT_LT(std::chrono::steady_clock::now(), deadline);
}

TEST_F(SandboxPeers, GetWithoutCopiesWhatTheyMayWriteOnlyWhenFree) {
    if (geteuid() != 0) GTEST_SKIP() << "takes two users";
    // The kernel shows others nothing of a process that changed its user, until it says that they may look.
    const auto ordinary = [] { return support::becomeOrdinaryUser() && prctl(PR_SET_DUMPABLE, 1) == 0; };
    const auto apart = [&] { return ordinary() && unshare(CLONE_NEWUSER | CLONE_NEWNS) == 0; };
    chmod(at("").c_str(), 0777);
    startBroker(ordinary);
    for (const auto& [owner, mode, error] : {std::tuple(support::ordinaryUser, 0444U, EPERM), // may change the mode
                                             {0U, 0666U, EPERM},
                                             {0U, 0644U, 0}}) {
        ASSERT_EQ(chown(at("Bundle/Font").c_str(), owner, owner), 0);
        chmod(at("Bundle/Font").c_str(), mode);
        const auto token = *issue("Bundle/Font");
        EXPECT_EQ(errorOfPeer(token, ordinary), 0) << owner << " " << mode;
        const int result = errorOfPeer(token, apart);
        if (result == cannot) GTEST_SKIP() << "may not make namespaces";
        EXPECT_EQ(result, error) << owner << " " << mode;
    }
}

TEST_F(SandboxPeers, OpenByTokenWhatTheirConfinementCloses) {
    const auto file = *issue("Bundle/Font");
    const auto directory = *issue("Bundle");
    startBroker();
    const int failures = support::resultInChild([&] {
        const int version = linux_::landlockVersion();
        EXPECT_FALSE(linux_::confine(*linux_::findConfinementProfile("keyboard"), {}, version));
        EXPECT_EQ(contentsAt(AT_FDCWD, at("Bundle/Font")), version > 0 ? "?" : "Bundle");
        EXPECT_EQ(contentsOf(descriptorOf(file)), "Bundle");
        EXPECT_EQ(contentsOf(subject.host.open(consumed(directory), "Font")->get()), "Bundle");
        return HasFailure() ? 1 : 0;
    });
    EXPECT_EQ(failures, 0);
}

TEST_F(SandboxPeers, KeepTheirFilePermissions) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    startBroker();
    for (const auto& [name, closed] : {std::pair("Bundle/Font", 0600U), {"Bundle2", 0700U}}) {
        const auto token = *issue(name);
        EXPECT_EQ(errorOfPeer(token, support::becomeOrdinaryUser), 0) << name;
        chmod(at(name).c_str(), closed);
        EXPECT_EQ(errorOfPeer(token, support::becomeOrdinaryUser), EACCES) << name;
        EXPECT_EQ(consumeError(token), 0) << name;
    }
}

TEST_F(SandboxPeers, FindASocketThatIsGivenUpAndTakenOver) {
    startBroker();
    {
        const linux_::Root root(subject.directory);
        linux_::Sandbox rival(root, linux_::SandboxRole::issuer);
        EXPECT_EQ(rival.startBroker()->code, EADDRINUSE);
        const auto permissions = fs::status(root.runtime() + "/com.nordane.sandbox").permissions();
        EXPECT_EQ(permissions, fs::perms(geteuid() == 0 ? 0666 : 0600));
        killBroker();
        EXPECT_EQ(consumeError("x"), ECONNREFUSED);
        EXPECT_FALSE(rival.startBroker());
        EXPECT_EQ(consumeError("x"), EPERM);
    }
    EXPECT_EQ(consumeError("x"), ENOENT);
    EXPECT_TRUE(subject.host.startBroker()) << "a host has no key";
}

TEST_F(LinuxSandbox, SilentAndUnmannerlyPeersDelayNobody) {
    const auto token = *issue("Bundle/Font");
    std::vector<linux_::Descriptor> peers;
    for (std::size_t count = 0; count < 3 * linux_::maximumSilentConnections; ++count)
        peers.push_back(*linux_::SandboxBroker::connect(linux_::Root(subject.directory)));
    EXPECT_EQ(consumeError(token), 0);
    char byte = 0;
    EXPECT_EQ(recv(peers.front().get(), &byte, 1, 0), 0) << "the oldest gave way";
    // The youngest may still speak, and is told that this is no token.
    linux_::Descriptor nothing;
    const std::string oversized(linux_::maximumTokenSize + 1, 'x');
    EXPECT_EQ(linux_::exchangeRequest(peers.back().get(), oversized, nothing), EINVAL);
    peers[peers.size() - 2].reset(); // leaves without reading
    EXPECT_EQ(consumeError(token), 0);
}

TEST_F(LinuxSandbox, BrokerSurvivesLackOfDescriptors) {
    const auto token = *issue("Bundle/Font");
    rlimit before{};
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
    // This process is host and daemon at once: with two numbers left, the host's socket takes what the daemon needs to
    // accept it.
    const int next = linux_::Descriptor(dup(0)).get();
    const rlimit tight{static_cast<rlim_t>(next) + 2, before.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &tight), 0);
    EXPECT_NE(consumeError(token), 0);
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &before), 0);
    EXPECT_EQ(consumeError(token), 0);
}

TEST_F(LinuxSandbox, ConfinementIsSeen) {
    const auto filtered = [] {
        sock_filter allow = BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW);
        sock_fprog filter{1, &allow};
        return prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 && prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &filter) == 0;
    };
    const std::tuple<const char*, support::Preparation, bool> cases[] = {
        {"free", support::atOnce, false},
        {"seccomp filter", filtered, true},
        {"mount namespace", [] { return unshare(CLONE_NEWNS) == 0; }, true},
        {"user namespace", [] { return unshare(CLONE_NEWUSER) == 0; }, true},
        {"root directory", [] { return chroot("/usr") == 0; }, true},
        // An ordinary user of root's daemon is no confined process.
        {"ordinary user", [] { return geteuid() == 0 && support::becomeOrdinaryUser(); }, false},
    };
    for (const auto& [what, prepare, isConfined] : cases) {
        const support::WaitingProgram child("/bin/cat", prepare);
        if (!child.runs()) continue; // may not
        EXPECT_EQ(issuer.isSandboxed(child.pid()), isConfined) << what;
    }
    support::WaitingProgram child("/bin/cat");
    const pid_t gone = child.pid();
    child.end();
    for (const std::int32_t nobody : {-1, 0, INT_MAX, gone}) EXPECT_TRUE(issuer.isSandboxed(nobody));
}
