#pragma once

#include "Zembra/AtomicField.h"
#include "platform/Error.h"
#include "platform/Sandbox.h"
#include "platform/Url.h"

#include <cstdint>
#include <memory>
#include <string>
#include <utility>

namespace zembra {

/// A token that grants reading the file or directory at `url`. When `within` is not empty, the service refuses a path
/// that leaves that directory once it is resolved. The error's code is an errno value; nothing is logged for it.
platform::Result<std::string> issueFileReadToken(platform::Sandbox& sandbox, const platform::URL& url,
                                                 const std::string& within = {});

/// A token that grants looking up the named service. The error's code is an errno value; nothing is logged for it.
platform::Result<std::string> issueServiceLookupToken(platform::Sandbox& sandbox, const std::string& service);

/// One extension token on the side that uses it. The right ends with the object at the latest.
/// Consumed and expelled from one thread at a time.
class ZBSandboxExtension final {
public:
    /// `sandbox` must outlive the object.
    static std::shared_ptr<ZBSandboxExtension> initWithExtension(platform::Sandbox& sandbox, std::string token);
    ~ZBSandboxExtension();
    ZBSandboxExtension(const ZBSandboxExtension&) = delete;
    ZBSandboxExtension& operator=(const ZBSandboxExtension&) = delete;

    std::string token() const { return _token.get(); }
    void setToken(std::string token) { _token.set(std::move(token)); }
    /// -1 unless the token is consumed.
    std::int64_t handle() const { return _handle; }

    /// Gains the right; does nothing when it is gained already. A failure is logged, and may be tried again.
    void consume();
    /// Gives the right back; does nothing when there is none. A failure is logged, and the right counts as given back.
    void expel();

    /// By token alone.
    bool isEqual(const ZBSandboxExtension& other) const { return token() == other.token(); }
    friend bool operator==(const ZBSandboxExtension& left, const ZBSandboxExtension& right) {
        return left.isEqual(right);
    }

private:
    ZBSandboxExtension(platform::Sandbox& sandbox, std::string token);

    platform::Sandbox& _sandbox;
    AtomicField<std::string> _token;
    std::int64_t _handle = -1;
};

} // namespace zembra
