#include "platform/linux/DescriptorStore.h"

#include <algorithm>
#include <cstddef>
#include <cstdlib>
#include <fcntl.h>
#include <systemd/sd-daemon.h>
#include <utility>

namespace platform::linux_ {

std::vector<PassedDescriptor> passedDescriptors() {
    std::vector<PassedDescriptor> passed;
    char** names = nullptr;
    const int count = sd_listen_fds_with_names(0, &names);        // the environment is left for others who ask
    passed.reserve(static_cast<std::size_t>(std::max(count, 0))); // negative: nothing that can be read
    for (int i = 0; i < count; ++i) passed.push_back({names != nullptr ? names[i] : "", SD_LISTEN_FDS_START + i});
    if (names != nullptr) {
        for (char** name = names; *name != nullptr; ++name) std::free(*name);
        std::free(names);
    }
    return passed;
}

DescriptorStore::Kept ServiceDescriptorStore::take(std::string_view prefix) {
    for (auto& [name, number] : passedDescriptors()) {
        if (!name.starts_with(prefix)) continue;
        Descriptor duplicate(fcntl(number, F_DUPFD_CLOEXEC, 0));
        if (duplicate) return {std::move(name), std::move(duplicate)};
    }
    return {};
}

bool ServiceDescriptorStore::keep(const std::string& name, int descriptor) {
    return sd_pid_notify_with_fds(0, 0, ("FDSTORE=1\nFDNAME=" + name).c_str(), &descriptor, 1) > 0;
}

void ServiceDescriptorStore::drop(const std::string& name) {
    sd_notify(0, ("FDSTOREREMOVE=1\nFDNAME=" + name).c_str());
}

} // namespace platform::linux_
