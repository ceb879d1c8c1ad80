#pragma once

#include "platform/linux/Descriptor.h"

#include <string>
#include <string_view>
#include <vector>

namespace platform::linux_ {

/// A descriptor that this process was started with, and its name, if it has one (sd_listen_fds_with_names(3)).
struct PassedDescriptor {
    std::string name;
    int number = -1; // stays with the environment that names it: who wants to close it makes a duplicate
};
std::vector<PassedDescriptor> passedDescriptors();

/// Keeps descriptors when the process ends, and hands them to the next one. Any thread.
class DescriptorStore {
public:
    struct Kept {
        std::string name;
        Descriptor descriptor; // with a name: open
    };

    virtual ~DescriptorStore() = default;

    /// The first descriptor that was handed to this process under a name that begins so, or none and no name. It stays
    /// in the store.
    virtual Kept take(std::string_view prefix) = 0;
    /// Names have no colon and no control characters. False when nobody keeps anything; whether it is really kept, the
    /// next process sees.
    virtual bool keep(const std::string& name, int descriptor) = 0;
    virtual void drop(const std::string& name) = 0;
};

/// The service manager's (sd_pid_notify_with_fds(3), FileDescriptorStoreMax= in systemd.service(5)).
class ServiceDescriptorStore final : public DescriptorStore {
public:
    Kept take(std::string_view prefix) override;
    bool keep(const std::string& name, int descriptor) override;
    void drop(const std::string& name) override;
};

} // namespace platform::linux_
