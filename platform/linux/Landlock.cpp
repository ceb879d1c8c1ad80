#include "platform/linux/Landlock.h"

#include "platform/linux/SystemError.h"

#include <cerrno>
#include <fcntl.h>
#include <linux/landlock.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

// Newer than the oldest kernel headers we build with, hence not from there; the values are the kernel's interface.
constexpr std::uint64_t fsRefer = 1ULL << 13U;            // version 2
constexpr std::uint64_t fsTruncate = 1ULL << 14U;         // version 3
constexpr std::uint64_t netBindTCP = 1ULL << 0U;          // version 4
constexpr std::uint64_t netConnectTCP = 1ULL << 1U;       // version 4
constexpr std::uint64_t fsIoctlDevice = 1ULL << 15U;      // version 5
constexpr std::uint64_t scopeAbstractSocket = 1ULL << 0U; // version 6
constexpr std::uint64_t scopeSignal = 1ULL << 1U;         // version 6

struct RulesetAttributes {
    std::uint64_t handledFiles;
    std::uint64_t handledNetwork; // version 4
    std::uint64_t scoped;         // version 6
};
constexpr std::size_t sizeOfVersion(int version) {
    if (version >= 6) return sizeof(RulesetAttributes);
    return version >= 4 ? 2 * sizeof(std::uint64_t) : sizeof(std::uint64_t);
}

constexpr std::uint64_t readRights = LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR;
constexpr std::uint64_t writeRights = LANDLOCK_ACCESS_FS_WRITE_FILE | fsTruncate;
constexpr std::uint64_t changeRights = writeRights | fsRefer | LANDLOCK_ACCESS_FS_REMOVE_DIR |
                                       LANDLOCK_ACCESS_FS_REMOVE_FILE | LANDLOCK_ACCESS_FS_MAKE_DIR |
                                       LANDLOCK_ACCESS_FS_MAKE_REG | LANDLOCK_ACCESS_FS_MAKE_SOCK |
                                       LANDLOCK_ACCESS_FS_MAKE_FIFO | LANDLOCK_ACCESS_FS_MAKE_SYM;
/// Those that a rule on a file, not a directory, may have.
constexpr std::uint64_t rightsOnFiles =
    LANDLOCK_ACCESS_FS_EXECUTE | LANDLOCK_ACCESS_FS_READ_FILE | writeRights | fsIoctlDevice;

constexpr std::uint64_t handledFiles(int version) {
    std::uint64_t handled = readRights | (changeRights & ~(fsRefer | fsTruncate)) | LANDLOCK_ACCESS_FS_EXECUTE |
                            LANDLOCK_ACCESS_FS_MAKE_CHAR | LANDLOCK_ACCESS_FS_MAKE_BLOCK;
    if (version >= 2) handled |= fsRefer;
    if (version >= 3) handled |= fsTruncate;
    if (version >= 5) handled |= fsIoctlDevice;
    return handled;
}

constexpr std::uint64_t handledNetwork(Network network) {
    switch (network) {
    case Network::none: return netBindTCP | netConnectTCP;
    case Network::client: return netBindTCP;
    case Network::server: break;
    }
    return 0;
}

} // namespace

int landlockVersion() {
    const long version = ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
    return version < 0 ? 0 : static_cast<int>(version);
}

Failure LandlockRules::begin(Network network) {
    _handled = handledFiles(_version);
    const RulesetAttributes attributes{_handled, handledNetwork(network), scopeAbstractSocket | scopeSignal};
    _rules =
        Descriptor(static_cast<int>(::syscall(SYS_landlock_create_ruleset, &attributes, sizeOfVersion(_version), 0)));
    if (!_rules) return systemError(errno, "landlock");
    return std::nullopt;
}

Failure LandlockRules::allow(int place, unsigned rights) {
    struct stat status{};
    if (::fstat(place, &status) != 0) return systemError(errno, "landlock");
    std::uint64_t allowed = 0;
    if ((rights & readFiles) != 0) allowed |= readRights;
    if ((rights & writeFiles) != 0) allowed |= writeRights;
    if ((rights & executeFiles) != 0) allowed |= LANDLOCK_ACCESS_FS_EXECUTE;
    if ((rights & changeFiles) != 0) allowed |= changeRights;
    allowed &= _handled;
    if (!S_ISDIR(status.st_mode)) allowed &= rightsOnFiles;
    landlock_path_beneath_attr rule{};
    rule.allowed_access = allowed;
    rule.parent_fd = place;
    if (::syscall(SYS_landlock_add_rule, _rules.get(), LANDLOCK_RULE_PATH_BENEATH, &rule, 0) != 0)
        return systemError(errno, "landlock");
    return std::nullopt;
}

Failure LandlockRules::allow(const char* path, unsigned rights) {
    const Descriptor place(::open(path, O_PATH | O_CLOEXEC));
    if (place) return allow(place.get(), rights);
    return errno == ENOENT ? Failure() : systemError(errno, path);
}

Failure LandlockRules::enforce() {
    if (::syscall(SYS_landlock_restrict_self, _rules.get(), 0) != 0) return systemError(errno, "landlock");
    return std::nullopt;
}

} // namespace platform::linux_
