#pragma once

#include "platform/Bundles.h"

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace platform {

/// The service that lets a keyboard use the network.
inline constexpr std::string_view keyboardNetworkAccess = "com.nordane.pvc.keyboard-network-access";

/// What the user decided about one privacy service for one application.
struct ConsentRecord {
    std::string service;
    std::optional<bool> granted;
};

/// The privacy-consent service "PVC".
class PrivacyConsent {
public:
    virtual ~PrivacyConsent() = default;
    /// The next question about the bundle is answered from what is stored then.
    virtual void flushBundleCaches(const BundleObject& bundle) = 0;
    /// One record per privacy service known for the application; none when the service cannot tell.
    virtual std::optional<std::vector<ConsentRecord>> informationForBundle(const BundleObject& bundle) = 0;
};

} // namespace platform
