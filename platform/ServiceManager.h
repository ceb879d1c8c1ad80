#pragma once

#include "platform/PropertyList.h"
#include "platform/Transport.h"
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
    /// Registers the executable as a service that the host process, and no other, may start until it ends. `overlay`
    /// is the plug-in's service description ("QMXService") with environment and sandbox profile. A later registration
    /// of the same executable for the same host replaces the earlier one. Returns 0 or an error number (errno.h).
    virtual int addExternalServiceForHost(const AuditToken& host, const std::string& executablePath,
                                          const Dictionary& overlay) = 0;
    /// Ends the running instances of the service of that bundle identifier and version. `completion` runs exactly
    /// once, on `queue`, after the instances ended. Returns at once.
    virtual void removeExternalService(const std::string& bundleIdentifier, const std::string& version,
                                       std::shared_ptr<WorkQueue> queue, std::function<void(int)> completion) = 0;
};

} // namespace platform
