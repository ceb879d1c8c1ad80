#include "platform/linux/Sandbox.h"
#include "platform/linux/SandboxBroker.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/SandboxFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
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
    ssize_t size = pread(descriptor, bytes, sizeof bytes, 0);
    return size < 0 ? "?" : std::string(bytes, static_cast<std::size_t>(size));
}

/// Two bundles with a resource each, the second's name beginning like the first's: `Bundle/Font`, `Bundle2/Font`.
struct LinuxSubject {
    support::ScratchDirectory scratch;
    linux_::Sandbox issuer{linux_::Root(scratch.path()), linux_::SandboxRole::issuer};
    linux_::Sandbox host{linux_::Root(scratch.path()), linux_::SandboxRole::consumer};
    std::string directory = scratch.path();

    LinuxSubject() {
        chmod(directory.c_str(), 0755);
        for (const char* bundle : {"Bundle", "Bundle2"}) {
            fs::create_directory(scratch / bundle);
            std::ofstream(scratch / bundle + "/Font") << bundle;
        }
        EXPECT_FALSE(issuer.startBroker());
    }
};
struct FakeSubject {
    support::FakeSandbox issuer;
    support::FakeSandbox& host = issuer;
    std::string directory = "/scratch";

    FakeSubject() {
        for (const char* name : {"Bundle", "Bundle/Font", "Bundle2/Font"})
            issuer.allowFile("/scratch/" + std::string(name));
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
};
using Subjects = testing::Types<FakeSubject, LinuxSubject>;
TYPED_TEST_SUITE(SandboxConformance, Subjects);

class LinuxSandbox : public SandboxConformance<LinuxSubject> {
protected:
    std::int64_t errorOf(const Result<std::string>& result) { return result ? 0 : result.error().code; }
    /// errno of consuming, 0 for success; the right is given back at once.
    int consumeError(const std::string& token) {
        int number = 0;
        std::int64_t handle = host.consume(token, number);
        if (handle < 0) return number;
        return host.release(handle, number);
    }
    /// The right's descriptor; it is kept until the test ends.
    int consumed(const std::string& token) {
        int number = 0;
        std::int64_t handle = host.consume(token, number);
        EXPECT_GE(handle, 0) << number;
        return subject.host.descriptor(handle);
    }
    static std::string readBelow(int directory, const char* name) {
        return contentsOf(linux_::Descriptor(openat(directory, name, O_RDONLY | O_CLOEXEC)).get());
    }
};

} // namespace

TYPED_TEST(SandboxConformance, TokenIsConsumedAndReleased) {
    auto file = this->issue("Bundle/Font", this->at("Bundle"));
    auto service = this->issuer.issueService(serviceClass, "any.service");
    ASSERT_TRUE(file && service);
    for (const auto& token : {*file, *service}) {
        int number = 0;
        std::int64_t first = this->host.consume(token, number);
        std::int64_t second = this->host.consume(token, number);
        ASSERT_GE(first, 0);
        EXPECT_NE(first, second);
        EXPECT_EQ(this->host.release(first, number), 0);
        EXPECT_NE(this->host.release(first, number), 0);
        EXPECT_EQ(number, EINVAL);
        EXPECT_EQ(this->host.release(second, number), 0);
    }
}

TYPED_TEST(SandboxConformance, WithinMeansBelowTheDirectory) {
    EXPECT_TRUE(this->issue("Bundle", this->at("Bundle")));
    EXPECT_EQ(this->issue("Bundle2/Font", this->at("Bundle")).error().code, EPERM);
}

TYPED_TEST(SandboxConformance, ConsumeRefusesWhatWasNotIssued) {
    for (const std::string token : {"", "x"}) {
        int number = 0;
        EXPECT_EQ(this->host.consume(token, number), -1);
        EXPECT_EQ(number, token.empty() ? EINVAL : EPERM);
    }
}

TEST_F(LinuxSandbox, IssueTellsWhyNot) {
    fs::create_symlink("../Bundle2/Font", at("Bundle/leaving"));
    ASSERT_EQ(mkfifo(at("Bundle/pipe").c_str(), 0600), 0);
    const std::string bundle = at("Bundle");
    const struct {
        std::string name, within;
        int number;
    } cases[] = {
        {"missing", "", ENOENT},
        {"Bundle/Font", at("missing"), ENOENT},
        {"Bundle/Font/x", "", ENOTDIR},
        {std::string(PATH_MAX, '/'), "", ENAMETOOLONG},
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
    std::ofstream(at(odd)) << "odd";
    fs::create_symlink(at("Bundle/Font"), at("Bundle/alias"));
    for (SandboxFlag flag : {SandboxFlag::canonical, SandboxFlag::none})
        for (const std::string& name : {std::string("Bundle/Font"), std::string("Bundle/alias"), odd}) {
            auto token = issuer.issueFile(sandboxReadExtensionClass, at(name), flag, at("Bundle"));
            ASSERT_TRUE(token) << token.error().text();
            EXPECT_TRUE(std::ranges::all_of(*token, [](char c) { return c > ' ' && c < 0x7f; }));
            int number = 0;
            std::int64_t handle = host.consume(*token, number);
            int descriptor = subject.host.descriptor(handle);
            EXPECT_EQ(contentsOf(descriptor), name == odd ? "odd" : "Bundle");
            EXPECT_EQ(fcntl(descriptor, F_GETFL) & O_ACCMODE, O_RDONLY);
            EXPECT_EQ(fcntl(descriptor, F_GETFD), FD_CLOEXEC);
            EXPECT_EQ(host.release(handle, number), 0);
            EXPECT_EQ(fcntl(descriptor, F_GETFD), -1) << "still open";
            EXPECT_EQ(subject.host.descriptor(handle), -1);
        }
    EXPECT_EQ(consumed(*issuer.issueService(serviceClass, "name")), -1) << "nothing to read";
}

TEST_F(LinuxSandbox, ConsumedDirectoryGivesWhatIsBelow) {
    int directory = consumed(*issue("Bundle"));
    EXPECT_EQ(readBelow(directory, "Font"), "Bundle");
    if (geteuid() != 0) return;
    // From here on as root's daemon: nothing above is reached, nothing can be changed.
    linux_::Descriptor copy(open_tree(AT_FDCWD, "/", OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC));
    if (!copy) GTEST_SKIP() << "may not copy mounts";
    EXPECT_EQ(readBelow(directory, "../Bundle2/Font"), "?");
    EXPECT_FALSE(linux_::Descriptor(openat(directory, "Font", O_WRONLY | O_CLOEXEC)));
    EXPECT_EQ(errno, EROFS);
}

TEST_F(LinuxSandbox, ReadingGivesNoWayToWrite) {
    int number = 0;
    const auto bundle = host.consume(*issue("Bundle"), number);
    const auto below = subject.host.open(bundle, "Font");
    ASSERT_TRUE(below) << below.error().text();
    const linux_::Descriptor copy(open_tree(AT_FDCWD, "/", OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC));
    if (!copy) GTEST_SKIP() << "may not copy mounts";
    for (int file : {consumed(*issue("Bundle/Font")), below->get()}) {
        const std::string again = "/proc/self/fd/" + std::to_string(file);
        EXPECT_EQ(contentsOf(linux_::Descriptor(open(again.c_str(), O_RDONLY | O_CLOEXEC)).get()), "Bundle");
        EXPECT_FALSE(linux_::Descriptor(open(again.c_str(), O_RDWR | O_CLOEXEC)));
        EXPECT_EQ(errno, EROFS);
        EXPECT_NE(fchmod(file, 0666), 0);
    }
}

TEST_F(LinuxSandbox, WithoutCopiesOnlyFreePeersGetWhatTheyMayWrite) {
    if (geteuid() != 0) GTEST_SKIP() << "takes two users";
#ifdef __SANITIZE_THREAD__
    GTEST_SKIP() << "the thread sanitizer lets no child of a process with threads start threads";
#endif
    chmod(at("").c_str(), 0777);
    for (const char* name : {"Theirs", "Open", "Closed"}) std::ofstream(at(name)) << name;
    chmod(at("Open").c_str(), 0666);
    EXPECT_EQ(chown(at("Theirs").c_str(), support::ordinaryUser, support::ordinaryUser), 0);
    chmod(at("Theirs").c_str(), 0444); // until its owner changes that
    const auto result = support::resultInChild([&] {
        // The kernel shows others nothing of a process that changed its user, until it says that they may look.
        if (!support::becomeOrdinaryUser() || prctl(PR_SET_DUMPABLE, 1) != 0) return 99;
        const linux_::Root root(at("own"));
        linux_::Sandbox own(root, linux_::SandboxRole::issuer);
        linux_::Sandbox peer(root, linux_::SandboxRole::consumer);
        if (mkdir(at("own").c_str(), 0755) != 0 || own.startBroker()) return 1;
        for (const bool isFree : {true, false}) {
            for (const auto& [name, error] : {std::pair("Theirs", EPERM), {"Open", EPERM}, {"Closed", 0}}) {
                const auto token = *own.issueFile(sandboxReadExtensionClass, at(name), SandboxFlag::canonical, "");
                const int number = support::resultInChild([&] {
                    if (!isFree && unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) return 99;
                    int refusal = 0;
                    return peer.consume(token, refusal) >= 0 ? 0 : refusal;
                });
                if (number == 99) return 99;
                if (number != (isFree ? 0 : error)) return 2;
            }
        }
        return 0;
    });
    if (result == 99) GTEST_SKIP() << "may not make namespaces";
    EXPECT_EQ(result, 0);
}

TEST_F(LinuxSandbox, AlteredTokensAreRefused) {
    const std::string token = *issue("Bundle/Font");
    ASSERT_EQ(consumeError(token), 0);
    for (std::size_t index = 0; index < token.size(); ++index) {
        std::string altered = token;
        altered[index] ^= 1;
        EXPECT_EQ(consumeError(altered), EPERM) << index;
        altered[index] = static_cast<char>(token[index] ^ 0x20); // the other case
        EXPECT_EQ(consumeError(altered), EPERM) << index;
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
    auto replaced = *issue("Bundle/Font");
    auto moved = *issue("Bundle2/Font");
    fs::rename(at("Bundle"), at("Old"));
    EXPECT_EQ(consumeError(replaced), ENOENT);
    fs::create_directory(at("Bundle"));
    std::ofstream(at("Bundle/Font")) << "new";
    EXPECT_EQ(consumeError(replaced), ESTALE);
    EXPECT_EQ(consumeError(*issue("Bundle/Font")), 0);

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
    EXPECT_EQ(contentsOf(consumed(*issue("Bundle/alias"))), "Bundle2");

    // Inode numbers are used again.
    for (int round = 0; round < 20; ++round) {
        auto token = *issue("Bundle/Font");
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

TEST_F(LinuxSandbox, TokenLiftsNoFilePermissions) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    const auto file = *issue("Bundle/Font");
    const auto directory = *issue("Bundle2");
    const auto asOther = [&](const std::string& token) {
        return support::resultInChild([&] { return support::becomeOrdinaryUser() ? consumeError(token) : 99; });
    };
    const int allowed = asOther(file);
    if (allowed == 99) GTEST_SKIP() << "may not become another user";
    EXPECT_EQ(allowed, 0);
    EXPECT_EQ(asOther(directory), 0);
    chmod(at("Bundle/Font").c_str(), 0600);
    chmod(at("Bundle2").c_str(), 0700);
    EXPECT_EQ(asOther(file), EACCES);
    EXPECT_EQ(asOther(directory), EACCES);
    EXPECT_EQ(consumeError(file), 0) << "root again";
    EXPECT_EQ(consumeError(directory), 0);
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
    std::string oversized(linux_::maximumTokenSize + 1, 'x');
    ASSERT_GT(send(peers.back().get(), oversized.data(), oversized.size(), MSG_NOSIGNAL), 0);
    std::int32_t number = 0;
    EXPECT_EQ(recv(peers.back().get(), &number, sizeof number, 0), static_cast<ssize_t>(sizeof number));
    EXPECT_EQ(number, EINVAL);
    // One that leaves without reading.
    peers[peers.size() - 2] = linux_::Descriptor();
    EXPECT_EQ(consumeError(token), 0);
}

TEST_F(LinuxSandbox, BrokerSurvivesLackOfDescriptors) {
    const auto token = *issue("Bundle/Font");
    EXPECT_EQ(consumeError(token), 0);
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

TEST_F(LinuxSandbox, SocketIsGivenUpAndTakenOver) {
    linux_::Root root(at("other"));
    const std::string socketPath = root.runtime() + "/com.nordane.sandbox";
    linux_::Sandbox otherHost(root, linux_::SandboxRole::consumer);
    EXPECT_TRUE(otherHost.startBroker()) << "a host has no key";
    const auto asked = [&] {
        int number = 0;
        EXPECT_EQ(otherHost.consume("x", number), -1);
        return number;
    };
    linux_::Sandbox rival(root, linux_::SandboxRole::issuer);
    {
        linux_::Sandbox second(root, linux_::SandboxRole::issuer);
        ASSERT_FALSE(second.startBroker());
        EXPECT_EQ(rival.startBroker()->code, EADDRINUSE);
        EXPECT_EQ(fs::status(socketPath).permissions(), fs::perms(geteuid() == 0 ? 0666 : 0600));
    }
    EXPECT_EQ(asked(), ENOENT);
    // What a killed daemon leaves.
    support::resultInChild([&] {
        linux_::Sandbox killed(root, linux_::SandboxRole::issuer);
        if (!killed.startBroker()) _exit(0);
        return 1;
    });
    EXPECT_EQ(asked(), ECONNREFUSED);
    EXPECT_FALSE(rival.startBroker());
    EXPECT_EQ(asked(), EPERM);
}

TEST_F(LinuxSandbox, ConfinementIsSeen) {
    const auto filtered = [] {
        sock_filter allow = BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW);
        sock_fprog filter{1, &allow};
        return prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 && prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &filter) == 0;
    };
    const struct {
        const char* what;
        std::function<bool()> prepare;
        bool confined;
        const char* program = "/usr/bin/cat";
    } cases[] = {
        {"free", [] { return true; }, false},
        {"seccomp filter", filtered, true},
        {"mount namespace", [] { return unshare(CLONE_NEWNS) == 0; }, true},
        {"user namespace", [] { return unshare(CLONE_NEWUSER) == 0; }, true},
        {"root directory", [] { return chroot("/usr") == 0; }, true, "/bin/cat"},
        // An ordinary user of root's daemon is no confined process.
        {"ordinary user", [] { return geteuid() == 0 && support::becomeOrdinaryUser(); }, false},
    };
    for (const auto& [what, prepare, confined, program] : cases) {
        support::WaitingProgram child(program, prepare);
        if (!child.runs()) continue; // may not
        EXPECT_EQ(issuer.isSandboxed(child.pid()), confined) << what;
    }
    EXPECT_FALSE(issuer.isSandboxed(getpid()));
    support::WaitingProgram child("/bin/cat");
    const pid_t gone = child.pid();
    child.end();
    for (std::int32_t nobody : {-1, 0, INT_MAX, gone}) EXPECT_TRUE(issuer.isSandboxed(nobody));
}
