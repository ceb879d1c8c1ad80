#pragma once

#include "platform/linux/FileStatus.h"

#include <cstddef>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

struct evp_mac_ctx_st; // OpenSSL's

namespace platform::linux_ {

/// The longest token: an extension class and a path of PATH_MAX bytes, with every byte escaped.
inline constexpr std::size_t maximumTokenSize = 16384;

/// The right that a token stands for.
struct SandboxGrant {
    enum class Kind { file, service };
    Kind kind = Kind::file;
    std::string extensionClass;
    std::string name;       // the path or the service
    bool canonical = false; // files only: the path holds no symbolic links
    FileIdentity identity;  // files only
};

/// Turns grants into tokens and back. A token is printable text: a MAC in hexadecimal, then the grant's fields between
/// semicolons. Only the signer that made a token reads it. Callable from any thread.
class TokenSigner {
public:
    /// With a fresh random key.
    TokenSigner();
    ~TokenSigner();
    TokenSigner(const TokenSigner&) = delete;
    TokenSigner& operator=(const TokenSigner&) = delete;

    /// None when the system has no random numbers or no memory.
    std::optional<std::string> sign(const SandboxGrant& grant);
    /// None unless this signer made exactly this text.
    std::optional<SandboxGrant> verify(std::string_view token);

private:
    /// The MAC of `text` in hexadecimal; empty on failure.
    std::string macOf(std::string_view text);

    std::mutex _mutex;
    evp_mac_ctx_st* _context = nullptr; // guarded by _mutex; keeps the key's schedule; null when there is no key
};

} // namespace platform::linux_
