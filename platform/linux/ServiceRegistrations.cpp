#include "platform/linux/ServiceRegistrations.h"

#include "platform/linux/Bundles.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/SystemError.h"
#include "platform/linux/UserDirectory.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <climits>
#include <fcntl.h>
#include <filesystem>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

constexpr std::string_view identifierKey = "identifier";
constexpr std::string_view versionKey = "version";
constexpr std::string_view containerKey = "container";
constexpr std::string_view bundlePathKey = "bundlePath";
constexpr std::string_view executablePathKey = "executablePath";
constexpr std::string_view bundleKey = "bundle";
constexpr std::string_view executableKey = "executable";
constexpr std::string_view changeKey = "executableChange";
constexpr std::string_view overlayKey = "overlay";

/// Directories above an executable. Each one is searched for a manifest, so that a deep path must not be costly.
constexpr int maximumDepth = 64;

constexpr std::size_t pageSize = 4096; // the least that a file in memory takes

std::size_t chargeOf(std::size_t bytes) { return (bytes + pageSize - 1) / pageSize * pageSize; }

Array numbersOf(const FileIdentity& file) {
    return Array{Value(file.device), Value(file.inode), Value(file.bornSeconds), Value(file.bornNanoseconds)};
}

template <class Number> bool readNumber(const Value& value, Number& number) {
    const auto given = value.int64();
    if (!given) {
        const auto large = value.uint64();
        if (!large || !std::in_range<Number>(*large)) return false;
        number = static_cast<Number>(*large);
        return true;
    }
    if (!std::in_range<Number>(*given)) return false;
    number = static_cast<Number>(*given);
    return true;
}

bool readIdentity(const std::optional<Array>& numbers, FileIdentity& file) {
    return numbers && numbers->size() == 4 && readNumber((*numbers)[0], file.device) &&
           readNumber((*numbers)[1], file.inode) && readNumber((*numbers)[2], file.bornSeconds) &&
           readNumber((*numbers)[3], file.bornNanoseconds);
}

Descriptor openBelow(int directory, const std::string& path, int flags, std::uint64_t resolve) {
    open_how how{};
    how.flags = static_cast<std::uint64_t>(flags) | O_CLOEXEC;
    how.resolve = resolve | RESOLVE_NO_SYMLINKS;
    return Descriptor(static_cast<int>(::syscall(SYS_openat2, directory, path.c_str(), &how, sizeof how)));
}

struct OpenedFile {
    Descriptor descriptor;
    FileStatus status;
};

/// Both paths canonical. Zero, or an errno value.
int openBoth(const std::string& bundlePath, const std::string& executablePath, OpenedFile& bundle,
             OpenedFile& executable) {
    if (!executablePath.starts_with(bundlePath + '/')) return EINVAL;
    bundle.descriptor = openBelow(AT_FDCWD, bundlePath, O_PATH | O_DIRECTORY, 0);
    if (!bundle.descriptor) return errno;
    // Bound to the open directory, so that both belong together whatever happens to the path meanwhile.
    executable.descriptor =
        openBelow(bundle.descriptor.get(), executablePath.substr(bundlePath.size() + 1), O_PATH, RESOLVE_BENEATH);
    if (!executable.descriptor) return errno;
    if (const int number = readFileStatus(bundle.descriptor.get(), "", bundle.status)) return number;
    if (const int number = readFileStatus(executable.descriptor.get(), "", executable.status)) return number;
    return S_ISREG(executable.status.mode) ? 0 : EINVAL;
}

std::optional<std::uint64_t> numberOf(std::string_view text) {
    std::uint64_t number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
    return number;
}

/// Of who is charged for a host. Not left to be seen from the process: one that has executed a set-user-id program
/// shows several users. The dot keeps it out of listings.
constexpr const char* userFile = ".user";
constexpr std::size_t maximumUserLength = 10; // of an id's digits

constexpr int directoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

/// Zero for a directory of this process's user, or the superuser, that is closed to all others: environments are in it.
int privacyError(const Descriptor& directory) {
    struct stat status{};
    if (!directory || ::fstat(directory.get(), &status) != 0) return errno;
    if (status.st_uid != 0 && status.st_uid != ::geteuid()) return EPERM;
    return (status.st_mode & 077) != 0 ? EACCES : 0;
}

/// Under a new name. What a crash leaves cut off is no registration, for it does not decode.
int writeNew(const std::string& path, std::string_view bytes) {
    const Descriptor file(::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    if (!file) return errno;
    while (!bytes.empty()) {
        const ssize_t size = ::write(file.get(), bytes.data(), bytes.size());
        if (size < 0 && errno == EINTR) continue;
        if (size < 0) {
            const int number = errno;
            ::unlink(path.c_str());
            return number;
        }
        bytes.remove_prefix(static_cast<std::size_t>(size));
    }
    return 0;
}

/// Zero, or an errno value.
int recordUser(const std::string& directory, uid_t user) {
    const std::string path = directory + '/' + userFile;
    if (recordedUser(AT_FDCWD, path) == user) return 0;
    if (::unlink(path.c_str()) != 0 && errno != ENOENT) return errno;
    return writeNew(path, std::to_string(user));
}

} // namespace

std::optional<uid_t> recordedUser(int directory, const std::string& name) {
    const auto text = readFile(directory, name, maximumUserLength);
    if (!text || !*text) return std::nullopt;
    uid_t user = 0;
    const char* const end = (*text)->data() + (*text)->size();
    const auto parsed = std::from_chars((*text)->data(), end, user);
    return parsed.ec == std::errc() && parsed.ptr == end ? std::optional(user) : std::nullopt;
}

std::string ServiceRegistration::encoded() const {
    std::string bytes(compactMagic);
    appendCompact(bytes, Dictionary{{identifierKey, service.identifier},
                                    {versionKey, service.version},
                                    {containerKey, container},
                                    {bundlePathKey, bundlePath},
                                    {executablePathKey, executablePath},
                                    {bundleKey, numbersOf(bundle)},
                                    {executableKey, numbersOf(executable.identity)},
                                    {changeKey, Array{Value(executable.mode), Value(executable.changedSeconds),
                                                      Value(executable.changedNanoseconds)}},
                                    {overlayKey, overlay}});
    return bytes;
}

std::optional<ServiceRegistration> ServiceRegistration::decoded(std::string_view bytes) {
    const auto value = decodePropertyList(bytes);
    const auto fields = value ? value->dictionary() : std::nullopt;
    if (!fields) return std::nullopt;
    const auto identifier = fields->string(identifierKey);
    const auto version = fields->string(versionKey);
    const auto container = fields->string(containerKey);
    const auto bundlePath = fields->string(bundlePathKey);
    const auto executablePath = fields->string(executablePathKey);
    const auto change = fields->array(changeKey);
    const auto overlay = fields->dictionary(overlayKey);
    if (!identifier || !version || !container || !bundlePath || !executablePath || !change || change->size() != 3 ||
        !overlay) {
        return std::nullopt;
    }
    ServiceRegistration registration{{std::string(*identifier), std::string(*version)},
                                     std::string(*container),
                                     std::string(*bundlePath),
                                     std::string(*executablePath),
                                     {},
                                     {},
                                     *overlay};
    FileStatus& executable = registration.executable;
    const bool isComplete =
        readIdentity(fields->array(bundleKey), registration.bundle) &&
        readIdentity(fields->array(executableKey), executable.identity) && readNumber((*change)[0], executable.mode) &&
        readNumber((*change)[1], executable.changedSeconds) && readNumber((*change)[2], executable.changedNanoseconds);
    return isComplete ? std::optional(std::move(registration)) : std::nullopt;
}

namespace {

/// The bundle whose executable this canonical path is. None when there are two, for who is meant cannot be told.
std::shared_ptr<const BundleObject> onlyBundleOf(platform::Files& files, const std::string& executable) {
    std::shared_ptr<const BundleObject> found;
    std::string directory = executable;
    for (int depth = 0; depth <= maximumDepth; ++depth) {
        directory.resize(directory.rfind('/'));
        if (directory.empty()) return found;
        auto bundle = Bundles(files).fromPath(directory, BundleMode::directory);
        if (bundle->property(BundleProperty::executablePath) != executable) continue;
        if (found) return nullptr;
        found = std::move(bundle);
    }
    return nullptr;
}

/// The identifier under which the registry makes the plug-in's data container: the plug-in's own, else the bundle's.
std::string containerOf(const Dictionary& info, const std::string& bundleIdentifier) {
    auto plugIn = info.dictionary("VKExtension");
    if (!plugIn) plugIn = info.dictionary("Zembra");
    const auto own = plugIn ? plugIn->string("VKExtensionIdentifier") : std::nullopt;
    return own ? std::string(*own) : bundleIdentifier;
}

} // namespace

Result<ServiceRegistration> registrationOf(platform::Files& files, const std::string& executablePath,
                                           const Dictionary& overlay) {
    const auto executable = files.realPath(executablePath, PATH_MAX);
    const auto bundle = executable ? onlyBundleOf(files, *executable) : nullptr;
    const auto path = bundle ? bundle->property(BundleProperty::path) : std::nullopt;
    const auto info = bundle ? bundle->infoDictionary() : std::nullopt;
    const auto identifier = info ? info->string("VBBundleIdentifier") : std::nullopt;
    if (!path || !identifier) return systemError(EINVAL, executablePath);
    const std::string container = containerOf(*info, std::string(*identifier));
    if (const int number = pathComponentError(container)) return systemError(number, executablePath);
    // Removals name a service whose manifest has no version so.
    const auto version = info->string("VBBundleVersion").value_or("1");

    ServiceRegistration registration{
        {std::string(*identifier), std::string(version)}, container, *path, *executable, {}, {}, overlay};
    OpenedFile openedBundle;
    OpenedFile openedExecutable;
    if (const int number = openBoth(*path, *executable, openedBundle, openedExecutable)) {
        return systemError(number, executablePath);
    }
    registration.bundle = openedBundle.status.identity;
    registration.executable = openedExecutable.status;
    return registration;
}

Result<OpenedService> openService(const ServiceRegistration& registration) {
    OpenedFile bundle;
    OpenedFile executable;
    if (const int number = openBoth(registration.bundlePath, registration.executablePath, bundle, executable)) {
        return systemError(number, registration.executablePath);
    }
    if (bundle.status.identity != registration.bundle || executable.status != registration.executable) {
        return systemError(ESTALE, registration.executablePath);
    }
    return OpenedService{std::move(bundle.descriptor), std::move(executable.descriptor)};
}

int ServiceRegistrations::load() {
    const Descriptor directory = openDirectory(AT_FDCWD, _directory);
    if (!directory) return errno == ENOENT ? 0 : errno;
    if (const int number = privacyError(directory)) return number;
    const auto listing = listDirectory(directory.get());
    if (!listing) return errno;
    const std::lock_guard lock(_mutex);
    for (const auto& name : listing->directories) {
        const auto identity = ProcessIdentity::named(name);
        // A host that lives keeps what it has, also when this process is short of something or cannot tell whose it
        // is: it is taken up with the next registration.
        if (identity && takeUp(name, *identity) != ESRCH) continue;
        std::error_code ignored; // tried again at the next start
        std::filesystem::remove_all(pathOf(name), ignored);
    }
    return 0;
}

int ServiceRegistrations::takeUp(const std::string& name, const ProcessIdentity& identity) {
    auto user = recordedUser(AT_FDCWD, pathOf(name) + '/' + userFile);
    if (!user) user = ownerOf(identity.pid);
    if (!user) return openProcess(identity) ? EPERM : errno;
    Host* ignored = nullptr;
    return host(identity, *user, ignored);
}

void ServiceRegistrations::loadServices(const std::string& name, Host& host) {
    const Descriptor directory = openDirectory(AT_FDCWD, pathOf(name));
    const auto listing = directory ? listDirectory(directory.get()) : std::nullopt;
    if (!listing) return;
    for (const auto& file : listing->others) {
        const auto number = numberOf(file).value_or(0); // they begin with 1
        const auto bytes = readFile(directory.get(), file, maximumRegistrationSize);
        _next = std::max(_next, number + 1);
        if (!bytes && isShortage(static_cast<int>(bytes.error().code))) continue;
        const auto registration = number != 0 && bytes && *bytes ? ServiceRegistration::decoded(**bytes) : std::nullopt;
        Entry* known = registration ? &host.services[registration->executablePath] : nullptr;
        // The one that was replaced may be left.
        if (known == nullptr || known->number > number) {
            ::unlinkat(directory.get(), file.c_str(), 0);
            continue;
        }
        replace(name, host, *known, {registration->service, number, chargeOf((*bytes)->size())});
    }
}

void ServiceRegistrations::replace(const std::string& name, Host& host, Entry& known, const Entry& entry) {
    if (known.number != 0) ::unlink((pathOf(name) + '/' + std::to_string(known.number)).c_str());
    for (std::size_t* bytes : {&host.bytes, &_users[host.user].bytes}) *bytes = *bytes - known.bytes + entry.bytes;
    known = entry;
}

int ServiceRegistrations::host(const ProcessIdentity& identity, uid_t user, Host*& host) {
    const std::string name = identity.name();
    const auto known = _hosts.find(name);
    if (known != _hosts.end()) {
        host = &known->second;
        return 0;
    }
    Descriptor process = openProcess(identity);
    if (!process) return errno;
    const auto usage = _users.find(user);
    if ((usage == _users.end() ? 0 : usage->second.hosts) >= _limits.hostsOfUser) return EDQUOT;
    if (::mkdir(_directory.c_str(), 0700) != 0 && errno != EEXIST) return errno;
    if (const int number = privacyError(Descriptor(::open(_directory.c_str(), directoryFlags)))) return number;
    const bool isNew = ::mkdir(pathOf(name).c_str(), 0700) == 0;
    if (!isNew && errno != EEXIST) return errno;
    int number = recordUser(pathOf(name), user);
    if (number == 0) number = _watch.add(std::move(process), pathOf(name));
    if (number != 0) {
        std::error_code ignored;
        if (isNew) std::filesystem::remove_all(pathOf(name), ignored);
        return number;
    }
    ++_users[user].hosts;
    host = &_hosts.emplace(name, Host{user, 0, {}}).first->second;
    if (!isNew) loadServices(name, *host);
    return 0;
}

int ServiceRegistrations::add(const ProcessIdentity& host, uid_t user, const ServiceRegistration& registration) {
    const std::string bytes = registration.encoded();
    if (bytes.size() > maximumRegistrationSize) return E2BIG;
    // The encoding holds values that no property list has; then the host learns it now, not at every launch.
    if (!ServiceRegistration::decoded(bytes)) return EINVAL;
    const std::lock_guard lock(_mutex);
    Host* entry = nullptr;
    if (const int number = this->host(host, user, entry)) return number;
    const auto known = entry->services.find(registration.executablePath);
    const std::size_t freed = known == entry->services.end() ? 0 : known->second.bytes;
    const std::size_t charge = chargeOf(bytes.size());
    if (entry->bytes - freed + charge > _limits.bytesOfHost ||
        _users[entry->user].bytes - freed + charge > _limits.bytesOfUser) {
        return EDQUOT;
    }
    const std::uint64_t number = _next++;
    if (const int failure = writeNew(pathOf(host.name()) + '/' + std::to_string(number), bytes)) return failure;
    replace(host.name(), *entry, entry->services[registration.executablePath], {registration.service, number, charge});
    return 0;
}

void ServiceRegistrations::remove(const ServiceName& service) {
    const std::lock_guard lock(_mutex);
    for (auto& [name, host] : _hosts) {
        for (auto at = host.services.begin(); at != host.services.end();) {
            const auto next = std::next(at);
            if (at->second.service == service) {
                replace(name, host, at->second, {});
                host.services.erase(at);
            }
            at = next;
        }
    }
}

Result<ServiceRegistrations::Found> ServiceRegistrations::find(const ProcessIdentity& host, std::string_view name) {
    const std::lock_guard lock(_mutex);
    const auto known = _hosts.find(host.name());
    const Entry* found = nullptr;
    if (known != _hosts.end()) {
        const bool isPath = name.find('/') != std::string_view::npos;
        for (const auto& [path, entry] : known->second.services) {
            const bool isMeant = isPath ? path == name : entry.service.identifier == name;
            if (isMeant && (found == nullptr || entry.number > found->number)) found = &entry;
        }
    }
    if (found == nullptr) return systemError(ENOENT, std::string(name));
    const std::string path = pathOf(known->first) + '/' + std::to_string(found->number);
    Descriptor file(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    if (!file) return systemError(errno, path);
    return Found{found->service, std::move(file)};
}

bool ServiceRegistrations::end(const std::string& path) {
    if (!path.starts_with(_directory + '/')) return false;
    const std::lock_guard lock(_mutex);
    if (const auto ended = _hosts.extract(path.substr(_directory.size() + 1))) {
        const auto usage = _users.find(ended.mapped().user);
        usage->second.bytes -= ended.mapped().bytes;
        if (--usage->second.hosts == 0) _users.erase(usage);
    }
    std::error_code ignored; // what is left belongs to a process that is no more, and goes at the next start
    std::filesystem::remove_all(path, ignored);
    return true;
}

} // namespace platform::linux_
