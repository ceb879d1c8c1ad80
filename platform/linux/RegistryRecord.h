#pragma once

#include "platform/Registry.h"
#include "platform/linux/BundleFacts.h"

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace platform::linux_ {

/// What is made of a record once and then handed out again; whoever keeps it guards it. Made anew when the user's
/// languages, which the generation counts, have changed.
template <class T> struct Made {
    std::shared_ptr<const T> object;
    std::uint64_t generation = 0;
};

/// One known application.
struct InstalledApplication {
    std::string path;
    BundleFactsRef facts;
    mutable Made<ApplicationRecord> record;
};
using InstalledApplicationRef = std::shared_ptr<const InstalledApplication>;

/// One registered plug-in, immutable but for what was made of it: a change makes another record.
struct InstalledPlugIn {
    std::string path;
    UUID uuid;
    std::optional<std::string> identifier;
    std::optional<std::string> originalIdentifier;
    Date registered;
    InstalledApplicationRef application; // null outside applications
    BundleFactsRef facts;
    mutable Made<PlugInProxy> proxy;
};
using InstalledPlugInRef = std::shared_ptr<const InstalledPlugIn>;

/// A plug-in that went, remembered so that it gets its UUID again when it comes back.
struct RemovedPlugIn {
    std::string path;
    UUID uuid;
    std::optional<std::string> identifier;
    std::optional<std::string> originalIdentifier;
    DirectoryIdentity identity;
};

/// Counts the states of the registry's data.
struct Knowledge {
    UUID uuid;
    std::uint64_t sequence = 0;
};

/// What a registry left to the next one that reads its database: a watch, by the name under which it is kept, that has
/// everything to tell that the database does not.
struct HandedOver {
    std::string watch;
    std::string places; // which directories bundles were looked for in, as text
};

// Each ordered by path.
using Applications = std::map<std::string, InstalledApplicationRef>;
using PlugIns = std::map<std::string, InstalledPlugInRef>;
using Exclusions = std::map<std::string, DirectoryIdentity>;
/// Each folder of applications with a digest of its state; 0 unless all that was in it is known.
using Listings = std::map<std::string, std::uint64_t>;

/// All that is installed, each in the order of the paths.
struct Installed {
    std::vector<InstalledPlugInRef> plugIns;
    std::vector<InstalledApplicationRef> applications;
};

/// The manifest's plug-in dictionary: "VKExtension", else the older "Zembra".
inline std::optional<Dictionary> plugInDictionary(const Dictionary& info) {
    if (auto dictionary = info.dictionary("VKExtension")) return dictionary;
    return info.dictionary("Zembra");
}

} // namespace platform::linux_
