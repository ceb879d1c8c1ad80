#pragma once

#include "platform/PropertyList.h"

#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace platform {

/// Key of an instance's bundle identifier in what the process-assertion service reports.
inline constexpr std::string_view instanceBundleIdentifierKey = "VBBundleIdentifier";

/// The process-assertion service "vigild": which running plug-in instances are busy.
class ProcessAssertions {
public:
    virtual ~ProcessAssertions() = default;
    /// One dictionary per busy running instance of the given bundle identifiers.
    virtual std::vector<Dictionary> busyExtensionInstances(const std::set<std::string>& bundleIdentifiers) = 0;
};

} // namespace platform
