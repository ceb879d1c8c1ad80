#pragma once

#include "platform/Error.h"

#include <chrono>
#include <cstdint>
#include <string>

namespace platform {

/// The class of tokens that grant reading below a path.
inline constexpr const char* sandboxReadExtensionClass = "com.nordane.app-sandbox.read";

enum class SandboxFlag { none, canonical };

/// Issues, consumes and releases extension tokens: texts that grant their bearer a right.
class Sandbox {
public:
    virtual ~Sandbox() = default;

    /// A token for reading `path` (a file, or a directory and what is below it): for what lies there now. With
    /// `canonical` the path is resolved first, and the token is for the result. `within`, when not empty, must hold the
    /// resolved path, or the service refuses (EPERM). The error carries errno.
    virtual Result<std::string> issueFile(const std::string& extensionClass, const std::string& path, SandboxFlag flag,
                                          const std::string& within) = 0;

    /// For how long after a token was issued the same question would get the same answer, or one that is as good.
    virtual std::chrono::milliseconds repeatInterval() const { return std::chrono::milliseconds(0); }

    /// A token for looking up the named service. The error carries errno.
    virtual Result<std::string> issueService(const std::string& extensionClass, const std::string& name) = 0;

    /// A handle, never negative, on the right; or -1 with `errorNumber` set.
    virtual std::int64_t consume(const std::string& token, int& errorNumber) = 0;

    /// 0 on success; any other value with `errorNumber` set.
    virtual int release(std::int64_t handle, int& errorNumber) = 0;

    /// True when the process runs confined: under a seccomp filter, in a foreign user or mount namespace, or with
    /// another root directory. Foreign is what is neither this process's own nor that of the machine's first process.
    /// Running as another user is no confinement in itself: a daemon of the whole machine serves many. A process that
    /// cannot be examined counts as confined; for one user's daemon those are other users' processes too.
    virtual bool isSandboxed(std::int32_t pid) = 0;
};

} // namespace platform
