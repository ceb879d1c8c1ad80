#pragma once

#include "platform/PropertyList.h"
#include "platform/Transport.h"

#include <memory>
#include <optional>
#include <string>

namespace platform {

/// The code-signing identity of one process.
class SecTask {
public:
    virtual ~SecTask() = default;
};

/// What a look-up of an entitlement gave. A service may report an error and still give a value.
struct EntitlementValue {
    Value value; // absent when the program has no such entitlement
    Failure error;
};

class CodeSigning {
public:
    virtual ~CodeSigning() = default;
    /// None when the token names no process that can be identified.
    virtual std::shared_ptr<SecTask> taskFromAuditToken(const AuditToken& token) = 0;
    /// Entitlements are those of the program that the process ran when it connected. They are read when first asked
    /// for, an error if by then the process is gone or runs another program, and kept for the task's life.
    virtual EntitlementValue copyEntitlement(const std::shared_ptr<SecTask>& task, const std::string& name) = 0;
};

} // namespace platform
