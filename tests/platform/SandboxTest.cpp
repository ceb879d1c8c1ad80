#include "platform/linux/Sandbox.h"
#include "platform/linux/ConfinementProfiles.h"
#include "platform/linux/SandboxBroker.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <climits>
#include <fstream>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>

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
class SandboxPeers : public testing::Test {
protected:
    SandboxPeers() {
        chmod(_scratch.path().c_str(), 0755);
        for (const std::string bundle : {"Bundle", "Bundle2"}) {
            fs::create_directory(at(bundle));
            std::ofstream(at(bundle) + "/Font") << bundle;
        }
    }
    ~SandboxPeers() override {
        if (_brokerProcess <= 0) return; // kill(2) takes such numbers for groups
        kill(_brokerProcess, SIGKILL);
        support::waitFor(_brokerProcess);
    }
    /// As another process, so that this one has no threads and its children may do anything.
    void startBroker() {
        _brokerProcess = support::startChild([&] { return _issuer.startBroker() ? 1 : pause(); });
        while (consumeError("x") != EPERM) ASSERT_EQ(waitpid(_brokerProcess, nullptr, WNOHANG), 0);
    }
    std::string at(const std::string& name) { return _scratch / name; }
    Result<std::string> issue(const std::string& name, const std::string& within = "") {
        return _issuer.issueFile(sandboxReadExtensionClass, at(name), SandboxFlag::canonical, within);
    }
    static std::int64_t errorOf(const auto& result) { return result ? 0 : result.error().code; }
    /// errno of consuming, 0 for success; the right is given back at once.
    int consumeError(const std::string& token) {
        int number = 0;
        const auto handle = _host.consume(token, number);
        return handle < 0 ? number : _host.release(handle, number);
    }
    /// The right to what the token is for, kept until the test ends.
    std::int64_t consumed(const std::string& token) {
        int number = 0;
        const auto handle = _host.consume(token, number);
        EXPECT_GE(handle, 0) << number;
        return handle;
    }
    int descriptorOf(const std::string& token) { return _host.descriptor(consumed(token)); }

    support::ScratchDirectory _scratch;
    linux_::Root _root{_scratch.path()};
    linux_::Sandbox _issuer{_root, linux_::SandboxRole::issuer};
    linux_::Sandbox _host{_root, linux_::SandboxRole::consumer};

private:
    pid_t _brokerProcess = 0;
};

class LinuxSandbox : public SandboxPeers {
protected:
    LinuxSandbox() { EXPECT_FALSE(_issuer.startBroker()); }
};

} // namespace

TEST_F(LinuxSandbox, IssueTellsWhyNot) {
    fs::create_symlink("../Bundle2/Font", at("Bundle/leaving"));
    ASSERT_EQ(mkfifo(at("Bundle/pipe").c_str(), 0600), 0);
    const std::pair<std::string, int> cases[] = {
        {"missing", ENOENT},
        {"Bundle2/Font", EPERM},
        {"Bundle/leaving", EPERM},
        {"Bundle/../Bundle2/Font", EPERM},
        {"Bundle/..", EPERM},
        {"Bundle/pipe", EINVAL},
        {std::string("Bundle/Font\0x", 13), EINVAL},
    };
    for (const auto& [name, number] : cases) EXPECT_EQ(errorOf(issue(name, at("Bundle"))), number) << name;
    EXPECT_EQ(errorOf(_issuer.issueService(serviceClass, std::string(256, 'n'))), EINVAL);
    EXPECT_EQ(errorOf(_host.issueService(serviceClass, "name")), EPERM);
}

TEST_F(LinuxSandbox, ConsumedFileIsReadable) {
    const std::string odd = "Bundle/%41;\n\xff ";
    std::ofstream(at(odd)) << "Bundle";
    fs::create_symlink(at("Bundle/Font"), at("Bundle/alias"));
    for (const SandboxFlag flag : {SandboxFlag::canonical, SandboxFlag::none})
        for (const std::string& name : {std::string("Bundle/alias"), odd}) {
            const auto token = *_issuer.issueFile(sandboxReadExtensionClass, at(name), flag, at("Bundle"));
            for (const char byte : token) EXPECT_TRUE(byte > ' ' && byte < 0x7f) << token;
            const auto handle = consumed(token);
            const int descriptor = _host.descriptor(handle);
            EXPECT_EQ(contentsOf(descriptor), "Bundle") << name;
            EXPECT_EQ(fcntl(descriptor, F_GETFD), FD_CLOEXEC);
            int number = 0;
            EXPECT_EQ(_host.release(handle, number), 0);
            EXPECT_NE(_host.release(handle, number), 0);
            EXPECT_EQ(fcntl(descriptor, F_GETFD), -1) << "still open";
        }
    EXPECT_EQ(descriptorOf(*_issuer.issueService(serviceClass, "name")), -1) << "nothing to read";
}

TEST_F(LinuxSandbox, DirectoryOpensWhatIsBelowAlone) {
    fs::create_symlink(at("Bundle2"), at("Bundle/leaving"));
    fs::create_directory(at("Bundle/folder"));
    const auto bundle = consumed(*issue("Bundle"));
    const std::pair<std::string, int> cases[] = {
        {"Font", 0},        {"../Bundle2/Font", EXDEV},           {at("Bundle2/Font"), EXDEV}, {"leaving/Font", EXDEV},
        {"folder", EISDIR}, {std::string(PATH_MAX, 'x'), EINVAL},
    };
    for (const auto& [path, error] : cases) EXPECT_EQ(errorOf(_host.open(bundle, path)), error) << path.substr(0, 40);
    EXPECT_EQ(errorOf(_host.open(consumed(*issue("Bundle/Font")), "Font")), ENOTDIR);
}

TEST_F(LinuxSandbox, ReadingGivesNoWayToWriteNorUpwards) {
    const auto bundle = consumed(*issue("Bundle"));
    const int directory = _host.descriptor(bundle);
    EXPECT_EQ(contentsAt(directory, "Font"), "Bundle");
    if (!linux_::Descriptor(open_tree(AT_FDCWD, "/", OPEN_TREE_CLONE | OPEN_TREE_CLOEXEC)))
        GTEST_SKIP() << "may not copy mounts";
    EXPECT_EQ(contentsAt(directory, "../Bundle2/Font"), "?");
    const auto opened = _host.open(bundle, "Font");
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
    for (std::size_t index = 0; index < token.size(); ++index) {
        for (const int difference : {1, 0x20}) { // 0x20: the other case
            std::string altered = token;
            altered[index] = static_cast<char>(token[index] ^ difference);
            EXPECT_EQ(consumeError(altered), EPERM) << index;
        }
        EXPECT_EQ(consumeError(token.substr(0, index)), index == 0 ? EINVAL : EPERM) << index;
    }
    EXPECT_EQ(consumeError(token + "0"), EPERM);
    EXPECT_EQ(consumeError(std::string(linux_::maximumTokenSize + 1, 'x')), EINVAL);
    linux_::Sandbox stranger(_root, linux_::SandboxRole::issuer);
    auto foreign = stranger.issueFile(sandboxReadExtensionClass, at("Bundle/Font"), SandboxFlag::canonical, "");
    EXPECT_EQ(consumeError(*foreign), EPERM);
    EXPECT_EQ(stranger.startBroker()->code, EADDRINUSE) << "nor does it take the socket over";
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

    // Inode numbers are used again.
    for (int round = 0; round < 20; ++round) {
        const auto token = *issue("Bundle/Font");
        fs::remove(at("Bundle/Font"));
        std::ofstream(at("Bundle/Font")) << "other";
        EXPECT_EQ(consumeError(token), ESTALE);
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
        EXPECT_EQ(contentsOf(_host.open(consumed(directory), "Font")->get()), "Bundle");
        return HasFailure() ? 1 : 0;
    });
    EXPECT_EQ(failures, 0);
}

TEST_F(SandboxPeers, KeepTheirFilePermissions) {
    if (geteuid() != 0) GTEST_SKIP() << "for root's daemon";
    startBroker();
    for (const auto& [name, closed] : {std::pair("Bundle/Font", 0600U), {"Bundle2", 0700U}}) {
        const auto token = *issue(name);
        for (const auto& [mode, error] : {std::pair(0755U, 0), {closed, EACCES}}) {
            chmod(at(name).c_str(), mode);
            const auto consume = [&] { return support::becomeOrdinaryUser() ? consumeError(token) : 99; };
            EXPECT_EQ(support::resultInChild(consume), error) << name;
            EXPECT_EQ(consumeError(token), 0) << name;
        }
    }
}

TEST_F(LinuxSandbox, SilentAndUnmannerlyPeersDelayNobody) {
    const auto token = *issue("Bundle/Font");
    std::vector<linux_::Descriptor> peers;
    for (std::size_t count = 0; count < 3 * linux_::maximumSilentConnections; ++count)
        peers.push_back(*linux_::SandboxBroker::connect(_root));
    EXPECT_EQ(consumeError(token), 0);
    char byte = 0;
    EXPECT_EQ(recv(peers.front().get(), &byte, 1, 0), 0) << "the oldest gave way";
    // The youngest may still speak, and is told that this is no token.
    linux_::Descriptor nothing;
    const std::string oversized(linux_::maximumTokenSize + 1, 'x');
    EXPECT_EQ(linux_::exchangeRequest(peers.back().get(), oversized, nothing), EINVAL);
}

TEST_F(LinuxSandbox, ConfinementIsSeen) {
    const std::tuple<const char*, support::Preparation, bool> cases[] = {
        {"free", support::atOnce, false},
        {"seccomp filter", [] { return support::loseSystemCall(SYS_clone3); }, true},
        {"mount namespace", [] { return unshare(CLONE_NEWNS) == 0; }, true},
        {"user namespace", [] { return unshare(CLONE_NEWUSER) == 0; }, true},
        {"root directory", [] { return chroot("/usr") == 0; }, true},
        // An ordinary user of root's daemon is no confined process.
        {"ordinary user", [] { return geteuid() == 0 && support::becomeOrdinaryUser(); }, false},
    };
    for (const auto& [what, prepare, isConfined] : cases) {
        const support::WaitingProgram child("/bin/cat", prepare);
        if (!child.runs()) continue; // may not
        EXPECT_EQ(_issuer.isSandboxed(child.pid()), isConfined) << what;
    }
    for (const std::int32_t nobody : {-1, 0, INT_MAX}) EXPECT_TRUE(_issuer.isSandboxed(nobody));
}
