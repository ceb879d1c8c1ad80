#pragma once

#include "platform/Error.h"
#include "platform/Files.h"
#include "platform/PropertyList.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/FileStatus.h"
#include "platform/linux/ProcessIdentity.h"
#include "platform/linux/ProcessWatch.h"

#include <compare>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace platform::linux_ {

/// Of an encoded registration, overlay included. Programs are given kilobytes of environment; the runtime directory is
/// memory.
inline constexpr std::size_t maximumRegistrationSize = 1U << 20U;

/// What the service manager keeps for one user's processes. Registrations lie in memory, and count in whole pages;
/// every host and every instance costs a descriptor.
struct ServiceLimits {
    std::size_t bytesOfHost = std::size_t{64} << 20U;
    std::size_t bytesOfUser = std::size_t{256} << 20U;
    std::size_t hostsOfUser = 1000; // as many as may be connected
    std::size_t instancesOfUser = 1000;
};

/// The user whose number is all that the file holds. None for any other file.
std::optional<uid_t> recordedUser(int directory, const std::string& name);

/// A service is what a bundle identifier and a version name.
struct ServiceName {
    std::string identifier;
    std::string version;
    friend auto operator<=>(const ServiceName&, const ServiceName&) = default;
};

/// What a host may start: one executable of one bundle, as both were when it was registered.
struct ServiceRegistration {
    ServiceName service;
    std::string container;      // whose data container it gets: the plug-in's identifier, not always the bundle's
    std::string bundlePath;     // canonical
    std::string executablePath; // canonical, below the bundle
    FileIdentity bundle;
    FileStatus executable; // also its last change: an executable that was written to is another program
    Dictionary overlay;

    /// As the compact encoding of a property list, with magic.
    std::string encoded() const;
    static std::optional<ServiceRegistration> decoded(std::string_view bytes);
};

/// A registration for the executable as it is now. EINVAL for what is no bundle's executable (a symbolic link to one
/// is followed, one that leaves the bundle is none), for bundles without an identifier, and for an executable that two
/// directories above it claim: a bundle could hold another one with the identifier of a stranger.
Result<ServiceRegistration> registrationOf(platform::Files& files, const std::string& executablePath,
                                           const Dictionary& overlay);
/// Opens the bundle (for paths below it) and the executable (to be executed). ESTALE when either is not what was
/// registered any more, ELOOP when a symbolic link has come into the way.
struct OpenedService {
    Descriptor bundle;
    Descriptor executable;
};
Result<OpenedService> openService(const ServiceRegistration& registration);

/// The registrations of external services, one directory per host process in `<root>/run/nordane/ignitd/hosts`, named
/// by pid and start time, with a numbered file per executable and one that names the user. They outlive the daemon and
/// end with the host. Callable from any thread.
class ServiceRegistrations {
public:
    /// `directory` must be one that only its owner can write to. Processes that end are told to `watch`, by the path of
    /// their directory.
    ServiceRegistrations(std::string directory, ProcessWatch& watch, const ServiceLimits& limits = {})
        : _directory(std::move(directory)), _watch(watch), _limits(limits) {}

    /// Takes up what an earlier daemon left of hosts that still run, and removes the rest. Zero, or an errno value.
    int load();
    /// Replaces an earlier registration of the same executable for the same host. `user` is charged. Zero, or an errno
    /// value: ESRCH when there is no such process, E2BIG for a registration beyond `maximumRegistrationSize`, EINVAL
    /// for one that could not be read again, EDQUOT when the host or the user has too many.
    int add(const ProcessIdentity& host, uid_t user, const ServiceRegistration& registration);
    /// Takes the service from every host.
    void remove(const ServiceName& service);
    /// A name with a separator is the path of an executable, another one a bundle identifier; of several the last
    /// registered one answers.
    struct Found {
        ServiceName service;
        Descriptor file; // the encoded registration, open for reading
    };
    Result<Found> find(const ProcessIdentity& host, std::string_view name);
    /// The host with this directory has ended. False when it is no host's.
    bool end(const std::string& path);

private:
    struct Entry {
        ServiceName service;
        std::uint64_t number = 0; // its file's; grows
        std::size_t bytes = 0;    // that are charged
    };
    struct Host {
        uid_t user;
        std::size_t bytes = 0;
        std::map<std::string, Entry> services; // by executable path
    };
    struct Usage {
        std::size_t hosts = 0;
        std::size_t bytes = 0;
    };

    std::string pathOf(const std::string& host) const { return _directory + '/' + host; }
    /// Takes up what lies in the host's directory. Zero, or an errno value: ESRCH when the host is gone.
    int takeUp(const std::string& name, const ProcessIdentity& identity);
    /// The host's entry. A missing one is made, with the registrations that lie in its directory.
    int host(const ProcessIdentity& identity, uid_t user, Host*& host);
    void loadServices(const std::string& name, Host& host);
    /// Puts an entry in the place of another one, or of none.
    void replace(const std::string& name, Host& host, Entry& known, const Entry& entry);

    const std::string _directory;
    ProcessWatch& _watch;
    const ServiceLimits _limits;
    std::mutex _mutex;
    std::map<std::string, Host> _hosts; // guarded by _mutex; by directory name
    std::map<uid_t, Usage> _users;      // guarded by _mutex; those that have hosts
    std::uint64_t _next = 1;            // guarded by _mutex
};

} // namespace platform::linux_
