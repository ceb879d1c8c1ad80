#include "platform/linux/PrivacyConsent.h"

#include "platform/SystemLog.h"
#include "platform/linux/FileTrust.h"
#include "platform/linux/SystemError.h"

#include <cerrno>
#include <unistd.h>

namespace platform::linux_ {

namespace {

constexpr const char* grantsName = "PrivacyConsent.vlist";
constexpr std::size_t maximumGrantsSize = 1U << 20U; // read as a whole for each question
constexpr std::size_t maximumManifestSize = 1U << 20U;

/// The identifier in the manifest of the bundle at `path`.
Result<std::string> identifierOf(const std::string& path) {
    const auto directory = openTrustedDirectory(path);
    if (!directory) return directory.error();
    // A daemon of an ordinary user has nobody to protect from the file systems that this user mounts.
    if (::geteuid() == 0 && !isTrustedFileSystem(directory->get())) return systemError(EPERM, path);
    const auto manifest = readTrustedDictionary(directory->get(), "Info.vlist", maximumManifestSize);
    if (!manifest) return manifest.error();
    const auto identifier = *manifest ? (*manifest)->string("VBBundleIdentifier") : std::nullopt;
    if (!identifier) return systemError(ENOENT, path + ": bundle identifier");
    return std::string(*identifier);
}

Result<std::vector<ConsentRecord>> recordsOf(const std::string& bundle, const std::string& database) {
    const auto identifier = identifierOf(bundle);
    if (!identifier) return identifier.error();
    std::vector<ConsentRecord> records;
    const auto directory = openTrustedDirectory(database);
    if (!directory && directory.error().code == ENOENT) return records;
    if (!directory) return directory.error();
    const auto grants = readTrustedDictionary(directory->get(), grantsName, maximumGrantsSize);
    if (!grants) return grants.error();
    const Value decided = *grants ? (**grants)[*identifier] : Value();
    if (!decided) return records;
    const auto services = decided.dictionary();
    if (!services) {
        return Error{propertyListErrorDomain, 0, std::string(grantsName) + ": no dictionary for " + *identifier};
    }
    for (const auto& service : *services) records.push_back({std::string(service.name()), service.value.boolean()});
    return records;
}

} // namespace

void PrivacyConsent::flushBundleCaches(const BundleObject& /*bundle*/) {}

std::optional<std::vector<ConsentRecord>> PrivacyConsent::informationForBundle(const BundleObject& bundle) {
    const auto path = bundle.property(BundleProperty::path);
    if (!path) return std::nullopt;
    auto records = recordsOf(*path, _directory);
    if (records) return *std::move(records);
    systemLog().defaultHandle().error("privacy consent cannot be told: %@", records.error());
    return std::nullopt;
}

} // namespace platform::linux_
