#pragma once

#include "platform/CodeSigning.h"

namespace platform::linux_ {

/// Entitlements of connected peers, from the attribute of the program file that the peer ran when it connected.
/// Tokens must come from the Linux transport. Callable from any thread.
class CodeSigning final : public platform::CodeSigning {
public:
    std::shared_ptr<SecTask> taskFromAuditToken(const AuditToken& token) override;
    /// A program without entitlements gives no value and no error.
    EntitlementValue copyEntitlement(const std::shared_ptr<SecTask>& task, const std::string& name) override;
};

} // namespace platform::linux_
