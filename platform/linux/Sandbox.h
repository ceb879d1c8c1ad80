#pragma once

#include "platform/Sandbox.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/FileStatus.h"
#include "platform/linux/Root.h"

#include <array>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

namespace platform::linux_ {

class SandboxBroker;
class TokenSigner;

enum class SandboxRole {
    issuer,  // the daemon: has a signing key of its own, made now; its tokens end with it
    consumer // a host: consumes through the daemon's broker; issues nothing (EPERM)
};

/// Extension tokens. The daemon's object signs them, and its broker turns them into descriptors; a host's object
/// consumes them through the broker. Callable from any thread.
class Sandbox final : public platform::Sandbox {
public:
    Sandbox(Root root, SandboxRole role);
    ~Sandbox() override;
    Sandbox(const Sandbox&) = delete;
    Sandbox& operator=(const Sandbox&) = delete;

    /// Listens under the root's runtime directory from now on, on a thread of its own, until destruction. Issuers only.
    Failure startBroker();
    /// Removes the broker's socket, for a process that ends without destroying this object.
    void removeBrokerName();

    /// Regular files and directories only (else EINVAL). The token is for what lies at the path now: once that is
    /// replaced, the token yields nothing.
    Result<std::string> issueFile(const std::string& extensionClass, const std::string& path, SandboxFlag flag,
                                  const std::string& within) override;
    std::chrono::milliseconds repeatInterval() const override;
    Result<std::string> issueService(const std::string& extensionClass, const std::string& name) override;
    /// Asks the broker and waits for it, at most some seconds. errno: EPERM for a token that this daemon did not sign,
    /// ESTALE when what it was for has been replaced, EINVAL for text that cannot be a token, EACCES when file
    /// permissions bar this process, and those of connect(2) when there is no broker.
    std::int64_t consume(const std::string& token, int& errorNumber) override;
    int release(std::int64_t handle, int& errorNumber) override;
    bool isSandboxed(std::int32_t pid) override;

    /// What a consumed file token opened: a file open for reading, or a directory to be used with openat(2). -1 for
    /// service tokens and unknown handles. Belongs to this object and is good until `release`.
    int descriptor(std::int64_t handle) const;

    /// Has the broker open a regular file below the directory of a consumed token, by its path from there. A process
    /// under Landlock cannot do it itself: its rules follow files to wherever a descriptor came from. Errors as those
    /// of `consume`, and EXDEV for a path that leaves the directory, EISDIR, EINVAL and ENOTDIR for what is no file.
    Result<Descriptor> open(std::int64_t handle, const std::string& path) const;

private:
    struct Right {
        std::string token;
        Descriptor opened; // not open for services
    };
    int ask(std::string_view request, Descriptor& opened) const;

    using Clock = std::chrono::steady_clock;

    /// Where a path led at `resolved`, and whether that was within the directory asked for.
    struct Resolution {
        std::string within;
        std::string canonicalPath;
        FileStatus status;
        Clock::time_point resolved;
        Clock::time_point looked; // when the file was last seen to be the same
        // The token made of it last: the same grant gives the same text.
        std::string tokenClass;
        bool tokenCanonical = false;
        std::string token;
    };
    struct ServiceToken {
        std::string extensionClass;
        std::string token;
    };
    std::optional<std::string> knownToken(const std::string& path, const std::string& extensionClass, bool canonical,
                                          const std::string& within);
    /// Zero, or an errno value.
    static int resolve(const std::string& path, const std::string& within, Resolution& resolution);

    bool isAskedAgain(const std::string& key);

    const Root _root;
    std::unique_ptr<TokenSigner> _signer; // issuers only
    std::unique_ptr<SandboxBroker> _broker;
    mutable std::mutex _mutex;
    std::unordered_map<std::string, Resolution> _resolutions;     // guarded by _mutex; by path
    std::unordered_map<std::string, ServiceToken> _serviceTokens; // guarded by _mutex; by name
    // Guarded by _mutex: hashes of what was asked for once, the last few of each class of them. Enough for all that may
    // be kept.
    std::array<std::array<std::uint32_t, 4>, 4096> _askedOnce{};
    std::map<std::int64_t, Right> _handles; // guarded by _mutex
    std::int64_t _nextHandle = 1;           // guarded by _mutex
};

} // namespace platform::linux_
