#pragma once

#include "platform/WorkQueue.h"

#include <functional>
#include <memory>
#include <string>

namespace platform {

/// Answers of `removeExternalService`; any other value is an error number.
inline constexpr int serviceInstancesTerminated = 0;
inline constexpr int serviceHasNoInstances = 3;

/// The service manager "ignitd": external services and their running instances.
class ServiceManager {
public:
    virtual ~ServiceManager() = default;
    /// Ends the running instances of the service of that bundle identifier and version. `completion` runs exactly
    /// once, on `queue`, after the instances ended. Returns at once.
    virtual void removeExternalService(const std::string& bundleIdentifier, const std::string& version,
                                       std::shared_ptr<WorkQueue> queue, std::function<void(int)> completion) = 0;
};

} // namespace platform
