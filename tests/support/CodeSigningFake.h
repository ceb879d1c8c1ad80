#pragma once

#include "platform/CodeSigning.h"

#include <map>

namespace support {

/// Entitlements by pid, in memory. Nobody has any until told otherwise.
class FakeCodeSigning final : public platform::CodeSigning {
public:
    std::map<std::int32_t, platform::Dictionary> entitlements;
    /// Set: every look-up reports it, and gives its value all the same.
    std::optional<platform::Error> failure;

    std::shared_ptr<platform::SecTask> taskFromAuditToken(const platform::AuditToken& token) override {
        return std::make_shared<Task>(token.pid);
    }

    platform::EntitlementValue copyEntitlement(const std::shared_ptr<platform::SecTask>& task,
                                               const std::string& name) override {
        const auto granted = entitlements.find(std::static_pointer_cast<Task>(task)->pid);
        return {granted == entitlements.end() ? platform::Value() : granted->second[name], failure};
    }

private:
    struct Task final : platform::SecTask {
        explicit Task(std::int32_t peer) : pid(peer) {}
        std::int32_t pid;
    };
};

} // namespace support
