#include "platform/linux/Sandbox.h"

#include "platform/linux/Confinement.h"
#include "platform/linux/RequestSocket.h"
#include "platform/linux/SandboxBroker.h"
#include "platform/linux/SandboxToken.h"
#include "platform/linux/SystemError.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <fcntl.h>
#include <functional>
#include <sys/stat.h>
#include <utility>

namespace platform::linux_ {

namespace {

constexpr std::size_t maximumNameLength = 255; // of classes and services, as long as a file name

/// Resolutions kept: a form asks for a handful of resources again and again; thousands of plug-ins fit.
constexpr std::size_t maximumResolutions = 8192;

/// A directory above may move without a sign at the file itself. A token made from an outdated resolution opens
/// nothing, so this bounds how long one is handed out in vain.
constexpr std::chrono::seconds resolutionLifetime{5};

/// One look at a file serves the answers of that time: among them are those of hosts that ask again and again, and a
/// look costs more than the rest of a form. A token handed out in vain meanwhile is like one from just before: it opens
/// nothing.
constexpr std::chrono::milliseconds lookLifetime{20};

/// Who keeps a token longer looks more seldom; what the registry watches it hears sooner that it was replaced.
constexpr std::chrono::milliseconds repeatLifetime{100};

bool isName(const std::string& text) {
    return !text.empty() && text.size() <= maximumNameLength && text.find('\0') == std::string::npos;
}

int canonicalise(const std::string& path, std::string& canonical) {
    std::unique_ptr<char, decltype(&std::free)> resolved(realpath(path.c_str(), nullptr), &std::free);
    if (!resolved) return errno;
    canonical = resolved.get();
    return 0;
}

/// Both canonical.
bool isWithin(const std::string& path, const std::string& directory) {
    if (!path.starts_with(directory)) return false;
    return path.size() == directory.size() || directory == "/" || path[directory.size()] == '/';
}

} // namespace

Sandbox::Sandbox(Root root, SandboxRole role) : _root(std::move(root)) {
    if (role == SandboxRole::issuer) _signer = std::make_unique<TokenSigner>();
}

Sandbox::~Sandbox() = default;

Failure Sandbox::startBroker() {
    if (!_signer) return systemError(EPERM, "sandbox broker");
    auto broker = SandboxBroker::start(_root, *_signer);
    if (!broker) return broker.error();
    _broker = *std::move(broker);
    return std::nullopt;
}

void Sandbox::removeBrokerName() {
    if (_broker) _broker->removeName();
}

/// The token of an earlier resolution, while the file is the one that it was made for.
std::optional<std::string> Sandbox::knownToken(const std::string& path, const std::string& extensionClass,
                                               bool canonical, const std::string& within) {
    const auto now = Clock::now();
    const auto isCurrent = [&](const Resolution& resolution) {
        return resolution.tokenCanonical == canonical && resolution.tokenClass == extensionClass &&
               resolution.within == within && now - resolution.resolved < resolutionLifetime;
    };
    {
        const std::lock_guard lock(_mutex);
        const auto known = _resolutions.find(path);
        if (known == _resolutions.end() || !isCurrent(known->second)) return std::nullopt;
        if (now - known->second.looked < lookLifetime) return known->second.token;
    }
    FileStatus status;
    if (readFileStatus(AT_FDCWD, path.c_str(), status) != 0) return std::nullopt;
    const std::lock_guard lock(_mutex);
    const auto known = _resolutions.find(path); // it may be another one by now
    if (known == _resolutions.end() || !isCurrent(known->second) || known->second.status != status) return std::nullopt;
    known->second.looked = now;
    return known->second.token;
}

int Sandbox::resolve(const std::string& path, const std::string& within, Resolution& resolution) {
    resolution.within = within;
    resolution.resolved = resolution.looked = Clock::now();
    if (int number = readFileStatus(AT_FDCWD, path.c_str(), resolution.status)) return number;
    if (int number = canonicalise(path, resolution.canonicalPath)) return number;
    if (!within.empty()) {
        std::string directory;
        if (int number = canonicalise(within, directory)) return number;
        if (!isWithin(resolution.canonicalPath, directory)) return EPERM;
    }
    // Anew, by the canonical path: the given one may lead elsewhere by now.
    if (int number = readFileStatus(AT_FDCWD, resolution.canonicalPath.c_str(), resolution.status)) return number;
    return S_ISREG(resolution.status.mode) || S_ISDIR(resolution.status.mode) ? 0 : EINVAL;
}

/// Whether it is worth keeping what was made for `key`: not for an answer that shows thousands of plug-ins once, where
/// what is kept would lie scattered among what goes, and hold its memory. With the lock held.
bool Sandbox::isAskedAgain(const std::string& key) {
    const std::size_t hash = std::hash<std::string>()(key);
    auto& recent = _askedOnce[hash % _askedOnce.size()];
    const auto mark = static_cast<std::uint32_t>(hash >> 32U) | 1U; // never that of an empty place
    if (std::find(recent.begin(), recent.end(), mark) != recent.end()) return true;
    std::shift_right(recent.begin(), recent.end(), 1);
    recent.front() = mark;
    return false;
}

Result<std::string> Sandbox::issueFile(const std::string& extensionClass, const std::string& path, SandboxFlag flag,
                                       const std::string& within) {
    if (!_signer) return systemError(EPERM, path);
    if (!isName(extensionClass) || !path.starts_with('/') || path.find('\0') != std::string::npos ||
        within.find('\0') != std::string::npos)
        return systemError(EINVAL, path);
    const bool canonical = flag == SandboxFlag::canonical;
    if (auto token = knownToken(path, extensionClass, canonical, within)) return *std::move(token);

    Resolution resolution;
    if (int number = resolve(path, within, resolution)) return systemError(number, path);
    auto token = _signer->sign({SandboxGrant::Kind::file, extensionClass, canonical ? resolution.canonicalPath : path,
                                canonical, resolution.status.identity});
    if (!token) return systemError(ENOMEM, path);
    resolution.tokenClass = extensionClass;
    resolution.tokenCanonical = canonical;
    resolution.token = *token;
    const std::lock_guard lock(_mutex);
    if (!isAskedAgain(path)) return *std::move(token);
    if (_resolutions.size() >= maximumResolutions) _resolutions.clear();
    _resolutions.insert_or_assign(path, std::move(resolution));
    return *std::move(token);
}

std::chrono::milliseconds Sandbox::repeatInterval() const { return repeatLifetime; }

Result<std::string> Sandbox::issueService(const std::string& extensionClass, const std::string& name) {
    if (!_signer) return systemError(EPERM, name);
    if (!isName(extensionClass) || !isName(name)) return systemError(EINVAL, name);
    {
        const std::lock_guard lock(_mutex);
        const auto known = _serviceTokens.find(name);
        if (known != _serviceTokens.end() && known->second.extensionClass == extensionClass) return known->second.token;
    }
    auto token = _signer->sign({SandboxGrant::Kind::service, extensionClass, name, false, {}});
    if (!token) return systemError(ENOMEM, name);
    const std::lock_guard lock(_mutex);
    if (!isAskedAgain(name)) return *std::move(token);
    if (_serviceTokens.size() >= maximumResolutions) _serviceTokens.clear();
    _serviceTokens.insert_or_assign(name, ServiceToken{extensionClass, *token});
    return *std::move(token);
}

std::int64_t Sandbox::consume(const std::string& token, int& errorNumber) {
    // An empty packet would read as a hang-up.
    if (token.empty() || token.size() > maximumTokenSize) {
        errorNumber = EINVAL;
        return -1;
    }
    Descriptor opened;
    if (int number = ask(token, opened)) {
        errorNumber = number;
        return -1;
    }
    std::lock_guard lock(_mutex);
    _handles.emplace(_nextHandle, Right{token, std::move(opened)});
    return _nextHandle++;
}

/// Zero, or an errno value.
int Sandbox::ask(std::string_view request, Descriptor& opened) const {
    auto connection = SandboxBroker::connect(_root);
    if (!connection) return static_cast<int>(connection.error().code);
    return exchangeRequest(connection->get(), request, opened);
}

Result<Descriptor> Sandbox::open(std::int64_t handle, const std::string& path) const {
    std::string request;
    {
        std::lock_guard lock(_mutex);
        const auto entry = _handles.find(handle);
        if (entry == _handles.end() || path.empty() || path.find('\0') != std::string::npos) {
            return systemError(EINVAL, path);
        }
        request = entry->second.token + '\0' + path;
    }
    Descriptor opened;
    if (const int number = ask(request, opened)) return systemError(number, path);
    if (!opened) return systemError(ENOTDIR, path);
    return opened;
}

int Sandbox::release(std::int64_t handle, int& errorNumber) {
    std::lock_guard lock(_mutex);
    if (_handles.erase(handle) == 1) return 0;
    errorNumber = EINVAL;
    return -1;
}

bool Sandbox::isSandboxed(std::int32_t pid) { return isConfined(pid); }

int Sandbox::descriptor(std::int64_t handle) const {
    std::lock_guard lock(_mutex);
    auto entry = _handles.find(handle);
    return entry == _handles.end() ? -1 : entry->second.opened.get();
}

} // namespace platform::linux_
