#include "platform/linux/Sandbox.h"
#include "platform/linux/SandboxBroker.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/SandboxFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <algorithm>
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
    std::string service = "any.service";

    LinuxSubject() {
        chmod(directory.c_str(), 0755);
        for (const char* bundle : {"Bundle", "Bundle2"}) {
            fs::create_directory(scratch / bundle);
            std::ofstream(scratch / bundle + "/Font") << bundle;
        }
        auto failure = issuer.startBroker();
        EXPECT_FALSE(failure) << failure->text();
    }
};
struct FakeSubject {
    support::FakeSandbox issuer;
    support::FakeSandbox& host = issuer;
    std::string directory = "/scratch";
    std::string service = "any.service";

    FakeSubject() {
        for (const char* path : {"/scratch/Bundle", "/scratch/Bundle/Font", "/scratch/Bundle2/Font"})
            issuer.allowFile(path);
        issuer.services.insert(service);
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
        std::int64_t handle = subject.host.consume(token, number);
        if (handle < 0) return number;
        subject.host.release(handle, number);
        return 0;
    }
};

} // namespace

TYPED_TEST(SandboxConformance, TokenIsConsumedAndReleased) {
    auto file = this->issue("Bundle/Font", this->at("Bundle"));
    auto service = this->issuer.issueService(serviceClass, this->subject.service);
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
    auto sibling = this->issue("Bundle2/Font", this->at("Bundle"));
    ASSERT_FALSE(sibling);
    EXPECT_EQ(sibling.error().code, EPERM);
}

TYPED_TEST(SandboxConformance, ConsumeRefusesWhatWasNotIssued) {
    const std::pair<std::string, int> tokens[] = {{"", EINVAL}, {"x", EPERM}, {std::string(200, '0'), EPERM}};
    for (const auto& [token, expected] : tokens) {
        int number = 0;
        EXPECT_EQ(this->host.consume(token, number), -1);
        EXPECT_EQ(number, expected);
    }
}

TEST_F(LinuxSandbox, IssueTellsWhyNot) {
    fs::create_symlink("loop", at("loop"));
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
        {"loop", "", ELOOP},
        {std::string(NAME_MAX + 1, 'n'), "", ENAMETOOLONG},
        {std::string(PATH_MAX, '/'), "", ENAMETOOLONG},
        {"Bundle/leaving", bundle, EPERM},
        {"Bundle/../Bundle2/Font", bundle, EPERM},
        {"Bundle/..", bundle, EPERM},
        {"Bundle/pipe", bundle, EINVAL},
        {std::string("Bundle/Font\0x", 13), "", EINVAL},
        {"Bundle/\xff", "", ENOENT},
    };
    for (const auto& [name, within, number] : cases) {
        EXPECT_EQ(errorOf(issue(name, within)), number) << name.substr(0, 40);
        EXPECT_EQ(errorOf(issue(name, within)), number) << "asked again: " << name.substr(0, 40);
    }
    auto relative = issuer.issueFile(sandboxReadExtensionClass, "Bundle", SandboxFlag::canonical, "");
    EXPECT_EQ(errorOf(relative), EINVAL);
    EXPECT_EQ(errorOf(issuer.issueService(serviceClass, std::string(256, 'n'))), EINVAL);
    EXPECT_EQ(errorOf(issuer.issueService("", "name")), EINVAL);
    EXPECT_EQ(errorOf(host.issueService(serviceClass, "name")), EPERM);
    EXPECT_EQ(errorOf(host.issueFile(sandboxReadExtensionClass, bundle, SandboxFlag::none, "")), EPERM);
}

TEST_F(LinuxSandbox, ConsumedFileIsReadable) {
    const std::string odd = "Bundle/%41;\n\xff ";
    std::ofstream(at(odd)) << "odd";
    fs::create_symlink(at("Bundle/Font"), at("Bundle/alias"));
    const std::pair<const char*, const char*> cases[] = {
        {"Bundle/Font", "Bundle"}, {"Bundle/alias", "Bundle"}, {odd.c_str(), "odd"}};
    for (SandboxFlag flag : {SandboxFlag::canonical, SandboxFlag::none}) {
        for (const auto& [name, contents] : cases) {
            auto token = issuer.issueFile(sandboxReadExtensionClass, at(name), flag, at("Bundle"));
            ASSERT_TRUE(token) << token.error().text();
            EXPECT_TRUE(std::ranges::all_of(*token, [](char c) { return c > ' ' && c < 0x7f; }));
            int number = 0;
            std::int64_t handle = host.consume(*token, number);
            ASSERT_GE(handle, 0) << number;
            int descriptor = subject.host.descriptor(handle);
            EXPECT_EQ(contentsOf(descriptor), contents);
            EXPECT_EQ(fcntl(descriptor, F_GETFL) & O_ACCMODE, O_RDONLY);
            EXPECT_NE(fcntl(descriptor, F_GETFD) & FD_CLOEXEC, 0);
            EXPECT_EQ(host.release(handle, number), 0);
            EXPECT_EQ(fcntl(descriptor, F_GETFD), -1) << "still open";
            EXPECT_EQ(subject.host.descriptor(handle), -1);
        }
    }
    int number = 0;
    std::int64_t service = host.consume(*issuer.issueService(serviceClass, "name"), number);
    EXPECT_GE(service, 0);
    EXPECT_EQ(subject.host.descriptor(service), -1);
}

TEST_F(LinuxSandbox, ConsumedDirectoryGivesWhatIsBelow) {
    int number = 0;
    std::int64_t handle = host.consume(*issue("Bundle"), number);
    ASSERT_GE(handle, 0) << number;
    int directory = subject.host.descriptor(handle);
    linux_::Descriptor font(openat(directory, "Font", O_RDONLY | O_CLOEXEC));
    EXPECT_EQ(contentsOf(font.get()), "Bundle");
    if (geteuid() != 0) return;
    // From here on as root's daemon: nothing above is reached, nothing can be changed.
    linux_::Descriptor above(openat(directory, "../Bundle2/Font", O_RDONLY | O_CLOEXEC));
    if (above) {
        linux_::Descriptor copy(open_tree(AT_FDCWD, "/", OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC));
        if (!copy) GTEST_SKIP() << "may not copy mounts";
    }
    EXPECT_FALSE(above);
    linux_::Descriptor written(openat(directory, "Font", O_WRONLY | O_CLOEXEC));
    EXPECT_FALSE(written);
    EXPECT_EQ(errno, EROFS);
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

    // Inode numbers are used again.
    for (int round = 0; round < 20; ++round) {
        auto token = *issue("Bundle/Font");
        fs::remove(at("Bundle/Font"));
        std::ofstream(at("Bundle/Font")) << "other";
        EXPECT_EQ(consumeError(token), ESTALE);
    }
}

TEST_F(LinuxSandbox, IssueNoticesThatALinkLeadsElsewhere) {
    fs::create_symlink("Font", at("Bundle/alias"));
    ASSERT_TRUE(issue("Bundle/alias", at("Bundle")));
    fs::remove(at("Bundle/alias"));
    fs::create_symlink(at("Bundle2/Font"), at("Bundle/alias"));
    EXPECT_EQ(errorOf(issue("Bundle/alias", at("Bundle"))), EPERM);
    auto token = issue("Bundle/alias");
    int number = 0;
    std::int64_t handle = host.consume(*token, number);
    EXPECT_EQ(contentsOf(subject.host.descriptor(handle)), "Bundle2");
}

TEST_F(LinuxSandbox, TokenLiftsNoFilePermissions) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    const auto file = *issue("Bundle/Font");
    const auto directory = *issue("Bundle2");
    const auto asOther = [&](const std::string& token) {
        return support::resultInChild([&] { return support::becomeOrdinaryUser() ? consumeError(token) : 99; });
    };
    if (asOther(file) == 99) GTEST_SKIP() << "may not become another user";
    EXPECT_EQ(asOther(file), 0);
    chmod(at("Bundle/Font").c_str(), 0600);
    EXPECT_EQ(asOther(file), EACCES);
    EXPECT_EQ(asOther(directory), 0);
    chmod(at("Bundle2").c_str(), 0700);
    EXPECT_EQ(asOther(directory), EACCES);
    EXPECT_EQ(consumeError(file), 0) << "root again";
    EXPECT_EQ(consumeError(directory), 0);
}

TEST_F(LinuxSandbox, ConfinedHostReachesWhatItCannotSee) {
    const auto token = *issue("Bundle");
    int result = support::resultInChild([&] {
        // The host sees the runtime directory and, of the rest, nothing.
        const std::string runtime = at("run");
        if (unshare(CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) return 9;
        linux_::Descriptor kept(open(runtime.c_str(), O_PATH | O_DIRECTORY));
        if (mount("none", subject.directory.c_str(), "tmpfs", 0, nullptr) != 0 || mkdir(runtime.c_str(), 0755) != 0 ||
            mount(("/proc/self/fd/" + std::to_string(kept.get())).c_str(), runtime.c_str(), nullptr, MS_BIND,
                  nullptr) != 0)
            return 9;
        if (fs::exists(at("Bundle"))) return 1;
        int number = 0;
        std::int64_t handle = subject.host.consume(token, number);
        if (handle < 0) return number == EPERM ? 9 : 2; // may mount, but may not copy mounts
        int directory = subject.host.descriptor(handle);
        linux_::Descriptor font(openat(directory, "Font", O_RDONLY));
        if (contentsOf(font.get()) != "Bundle") return 3;
        linux_::Descriptor above(openat(directory, "../Bundle2/Font", O_RDONLY));
        return above ? 4 : 0;
    });
    if (result == 9) GTEST_SKIP() << "may not mount";
    EXPECT_EQ(result, 0);
}

TEST_F(LinuxSandbox, SilentAndUnmannerlyPeersDelayNobody) {
    const auto token = *issue("Bundle/Font");
    std::vector<linux_::Descriptor> peers;
    for (std::size_t count = 0; count < 3 * linux_::maximumSilentConnections; ++count) {
        auto peer = linux_::SandboxBroker::connect(linux_::Root(subject.directory));
        ASSERT_TRUE(peer) << peer.error().text();
        peers.push_back(*std::move(peer));
    }
    EXPECT_EQ(consumeError(token), 0);
    char byte = 0;
    EXPECT_EQ(recv(peers.front().get(), &byte, 1, 0), 0) << "the oldest gave way";
    // The youngest may still speak, and is told that this is no token.
    std::string oversized(linux_::maximumTokenSize + 1, 'x');
    ASSERT_EQ(send(peers.back().get(), oversized.data(), oversized.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(oversized.size()));
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
    {
        auto waiting = linux_::SandboxBroker::connect(linux_::Root(subject.directory));
        rlimit before{};
        ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
        // This process is host and daemon at once: with two numbers left, the host's socket takes what the daemon
        // needs to accept it.
        linux_::Descriptor next(dup(0));
        rlimit tight{static_cast<rlim_t>(next.get()) + 2, before.rlim_max};
        next = linux_::Descriptor();
        ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &tight), 0);
        EXPECT_NE(consumeError(token), 0);
        ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &before), 0);
    }
    EXPECT_EQ(consumeError(token), 0);
}

TEST_F(LinuxSandbox, SocketIsGivenUpAndTakenOver) {
    linux_::Root root(at("other"));
    const std::string socketPath = root.runtime() + "/com.nordane.sandbox";
    auto second = std::make_unique<linux_::Sandbox>(root, linux_::SandboxRole::issuer);
    ASSERT_FALSE(second->startBroker());
    linux_::Sandbox rival(root, linux_::SandboxRole::issuer);
    auto taken = rival.startBroker();
    ASSERT_TRUE(taken);
    EXPECT_EQ(taken->code, EADDRINUSE);
    EXPECT_EQ(fs::status(socketPath).permissions() & fs::perms(0777), fs::perms(geteuid() == 0 ? 0666 : 0600));
    second.reset();
    EXPECT_FALSE(fs::exists(socketPath));

    int number = 0;
    linux_::Sandbox otherHost(root, linux_::SandboxRole::consumer);
    EXPECT_EQ(otherHost.consume("x", number), -1);
    EXPECT_EQ(number, ENOENT);
    EXPECT_TRUE(otherHost.startBroker()) << "a host has no key";
    // What a killed daemon leaves.
    support::resultInChild([&] {
        linux_::Sandbox killed(root, linux_::SandboxRole::issuer);
        if (!killed.startBroker()) _exit(0);
        return 1;
    });
    EXPECT_TRUE(fs::exists(socketPath));
    EXPECT_EQ(otherHost.consume("x", number), -1);
    EXPECT_EQ(number, ECONNREFUSED);
    EXPECT_FALSE(rival.startBroker());
    EXPECT_EQ(otherHost.consume("x", number), -1);
    EXPECT_EQ(number, EPERM);
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
    } cases[] = {
        {"free", [] { return true; }, false},
        {"seccomp filter", filtered, true},
        {"mount namespace", [] { return unshare(CLONE_NEWNS) == 0; }, true},
        {"user namespace", [] { return unshare(CLONE_NEWUSER) == 0; }, true},
        {"root directory", [] { return chroot("/usr") == 0; }, true},
        // An ordinary user of root's daemon is no confined process.
        {"ordinary user", [] { return geteuid() == 0 && support::becomeOrdinaryUser(); }, false},
    };
    for (const auto& [what, prepare, confined] : cases) {
        const bool moved = std::string_view(what) == "root directory";
        support::WaitingProgram child(moved ? "/bin/cat" : "/usr/bin/cat", prepare);
        if (!child.runs()) continue; // may not
        EXPECT_EQ(subject.issuer.isSandboxed(child.pid()), confined) << what;
        pid_t pid = child.pid();
        child.end();
        EXPECT_TRUE(subject.issuer.isSandboxed(pid)) << "gone";
    }
    EXPECT_FALSE(subject.issuer.isSandboxed(getpid()));
    for (std::int32_t nobody : {-1, 0, INT_MAX}) EXPECT_TRUE(subject.issuer.isSandboxed(nobody));
}
