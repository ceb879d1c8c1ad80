#include "platform/linux/DescriptorStore.h"

#include <cstdlib>
#include <fcntl.h>
#include <systemd/sd-daemon.h>
#include <utility>

namespace platform::linux_ {

DescriptorStore::Kept ServiceDescriptorStore::take(std::string_view prefix) {
    Kept kept;
    char** names = nullptr;
    const int count = sd_listen_fds_with_names(0, &names); // the environment is left for the sockets in it
    for (int i = 0; i < count && names != nullptr; ++i) {
        if (!std::string_view(names[i]).starts_with(prefix) || kept.descriptor) continue;
        // A duplicate is ours to close; the number itself stays with the environment that names it.
        Descriptor duplicate(fcntl(SD_LISTEN_FDS_START + i, F_DUPFD_CLOEXEC, 0));
        if (duplicate) kept = {names[i], std::move(duplicate)};
    }
    if (names != nullptr) {
        for (char** name = names; *name != nullptr; ++name) std::free(*name);
        std::free(names);
    }
    return kept;
}

bool ServiceDescriptorStore::keep(const std::string& name, int descriptor) {
    return sd_pid_notify_with_fds(0, 0, ("FDSTORE=1\nFDNAME=" + name).c_str(), &descriptor, 1) > 0;
}

void ServiceDescriptorStore::drop(const std::string& name) {
    sd_notify(0, ("FDSTOREREMOVE=1\nFDNAME=" + name).c_str());
}

} // namespace platform::linux_
