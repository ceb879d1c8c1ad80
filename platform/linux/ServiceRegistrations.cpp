#include "platform/linux/ServiceRegistrations.h"

#include "platform/linux/Bundles.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/SystemError.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
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
constexpr std::string_view bundlePathKey = "bundlePath";
constexpr std::string_view executablePathKey = "executablePath";
constexpr std::string_view bundleKey = "bundle";
constexpr std::string_view executableKey = "executable";
constexpr std::string_view changeKey = "executableChange";
constexpr std::string_view overlayKey = "overlay";

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

} // namespace

std::string ServiceRegistration::encoded() const {
    std::string bytes(compactMagic);
    appendCompact(bytes, Dictionary{{identifierKey, service.identifier},
                                    {versionKey, service.version},
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
    const auto bundlePath = fields->string(bundlePathKey);
    const auto executablePath = fields->string(executablePathKey);
    const auto change = fields->array(changeKey);
    const auto overlay = fields->dictionary(overlayKey);
    if (!identifier || !version || !bundlePath || !executablePath || !change || change->size() != 3 || !overlay) {
        return std::nullopt;
    }
    ServiceRegistration registration{{std::string(*identifier), std::string(*version)},
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

Result<ServiceRegistration> registrationOf(platform::Files& files, const std::string& executablePath,
                                           const Dictionary& overlay) {
    const auto bundle = Bundles(files).fromPath(executablePath, BundleMode::executable);
    const auto path = bundle->property(BundleProperty::path);
    const auto executable = bundle->property(BundleProperty::executablePath);
    const auto info = bundle->infoDictionary();
    const auto identifier = info ? info->string("VBBundleIdentifier") : std::nullopt;
    if (!path || !executable || !identifier) return systemError(EINVAL, executablePath);
    // Removals name a service whose manifest has no version so.
    const auto version = info->string("VBBundleVersion").value_or("1");

    ServiceRegistration registration{
        {std::string(*identifier), std::string(version)}, *path, *executable, {}, {}, overlay};
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
    const auto listing = listDirectory(directory.get());
    if (!listing) return errno;
    const std::lock_guard lock(_mutex);
    for (const auto& name : listing->directories) loadHost(name);
    return 0;
}

void ServiceRegistrations::loadHost(const std::string& name) {
    const auto identity = ProcessIdentity::named(name);
    Host* entry = nullptr;
    if (!identity || host(*identity, entry) != 0) {
        std::error_code ignored; // tried again at the next start
        std::filesystem::remove_all(pathOf(name), ignored);
        return;
    }
    const Descriptor directory = openDirectory(AT_FDCWD, pathOf(name));
    const auto listing = directory ? listDirectory(directory.get()) : std::nullopt;
    if (!listing) return;
    for (const auto& file : listing->others) {
        const auto number = numberOf(file).value_or(0); // they begin with 1
        const auto bytes = readFile(directory.get(), file, maximumRegistrationSize);
        const auto registration = number != 0 && bytes && *bytes ? ServiceRegistration::decoded(**bytes) : std::nullopt;
        Entry* known = registration ? &(*entry)[registration->executablePath] : nullptr;
        // The one that was replaced may be left.
        if (known == nullptr || known->number > number) {
            ::unlinkat(directory.get(), file.c_str(), 0);
            continue;
        }
        if (known->number != 0) ::unlinkat(directory.get(), std::to_string(known->number).c_str(), 0);
        *known = {registration->service, number};
        _next = std::max(_next, number + 1);
    }
}

int ServiceRegistrations::host(const ProcessIdentity& identity, Host*& host) {
    const std::string name = identity.name();
    const auto known = _hosts.find(name);
    if (known != _hosts.end()) {
        host = &known->second;
        return 0;
    }
    Descriptor process = openProcess(identity);
    if (!process) return errno;
    for (const auto& directory : {_directory, pathOf(name)}) {
        if (::mkdir(directory.c_str(), 0700) != 0 && errno != EEXIST) return errno;
    }
    if (const int number = _watch.add(std::move(process), pathOf(name))) {
        ::rmdir(pathOf(name).c_str());
        return number;
    }
    host = &_hosts[name];
    return 0;
}

int ServiceRegistrations::add(pid_t host, const ServiceRegistration& registration) {
    const auto identity = ProcessIdentity::of(host);
    if (!identity) return ESRCH;
    const std::string bytes = registration.encoded();
    if (bytes.size() > maximumRegistrationSize) return E2BIG;
    const std::lock_guard lock(_mutex);
    Host* entry = nullptr;
    if (const int number = this->host(*identity, entry)) return number;
    const std::string directory = pathOf(identity->name()) + '/';
    const std::uint64_t number = _next++;
    if (const int failure = writeNew(directory + std::to_string(number), bytes)) return failure;
    Entry& known = (*entry)[registration.executablePath];
    if (known.number != 0) ::unlink((directory + std::to_string(known.number)).c_str());
    known = {registration.service, number};
    return 0;
}

void ServiceRegistrations::remove(const ServiceName& service) {
    const std::lock_guard lock(_mutex);
    for (auto& [name, host] : _hosts) {
        std::erase_if(host, [&](const auto& item) {
            if (item.second.service != service) return false;
            ::unlink((pathOf(name) + '/' + std::to_string(item.second.number)).c_str());
            return true;
        });
    }
}

Result<ServiceRegistrations::Found> ServiceRegistrations::find(const ProcessIdentity& host, std::string_view name) {
    const std::lock_guard lock(_mutex);
    const auto known = _hosts.find(host.name());
    const Entry* found = nullptr;
    if (known != _hosts.end()) {
        const bool isPath = name.find('/') != std::string_view::npos;
        for (const auto& [path, entry] : known->second) {
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
    _hosts.erase(path.substr(_directory.size() + 1));
    std::error_code ignored; // what is left belongs to a process that is no more, and goes at the next start
    std::filesystem::remove_all(path, ignored);
    return true;
}

} // namespace platform::linux_
