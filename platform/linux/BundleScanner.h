#pragma once

#include "platform/linux/BundleFacts.h"

#include <cstddef>
#include <functional>
#include <string>

namespace platform::linux_ {

inline constexpr const char* manifestName = "Info.vlist";
inline constexpr const char* resourcesName = "Resources";
inline constexpr const char* plugInsName = "PlugIns";
inline constexpr std::string_view tableSuffix = ".vlist";

/// A manifest is a page of text; what is larger is a mistake or an attack.
inline constexpr std::size_t maximumManifestSize = 1U << 20U;

/// Values in a manifest, those in its arrays and dictionaries included. Real ones have dozens, a few hundreds. The size
/// alone is no bound: a million values of a byte each take up a hundred times the memory once they are decoded.
inline constexpr std::size_t maximumManifestValues = 20'000;

/// Languages of a bundle, and string tables of a language, that are looked at.
inline constexpr std::size_t maximumResourceEntries = 256;

/// What is read of a bundle's string tables to tell whether they changed. Those beyond are only listed, so that a
/// bundle of many large tables costs neither memory nor time.
inline constexpr std::size_t maximumTablesSize = std::size_t{4} << 20U;

enum class BundleKind { application, plugIn };

/// How much of a bundle is compared with what is known of it.
enum class Look {
    cursory,  // what there is to choose from: an application's folder of plug-ins, a plug-in's manifest
    thorough, // everything that was read
};

struct ScannedBundle {
    enum class State {
        absent,     // no manifest: not a bundle
        unfinished, // an empty manifest: its writer is about to fill it
        unusable,   // with a reason
        unknown,    // the system is short of something
        unchanged,  // the facts that were known are still true
        read,       // new facts
    };
    State state = State::absent;
    std::string reason;
    DirectoryIdentity identity; // of the directory, in every state
    BundleFactsRef facts;
};

/// Reads bundles from disk. Nothing that a bundle contains makes it block, follow links or take more memory than the
/// bounds above. Any thread; `watch` is called by `scan` alone.
class BundleScanner {
public:
    /// Called with each directory of a bundle before anything in it is looked at, so that whoever watches it misses
    /// no later change.
    using Watch = std::function<void(int directory, const std::string& path)>;

    BundleScanner(Watch watch, SharedStrings& strings) : _watch(std::move(watch)), _strings(strings) {}

    /// `directory` is open, `path` its name for `watch`. `known` are the facts of an earlier scan, or null.
    ScannedBundle scan(int directory, const std::string& path, BundleKind kind, const BundleFactsRef& known) const;

    /// Whether the files of the bundle at `path` are still those that `known` were read from, and of an application
    /// also whether the same plug-ins lie in it. False also for doubt.
    static bool isUnchanged(const std::string& path, BundleKind kind, const BundleFacts& known);
    /// The same for the bundle at `name`, a path below the open `directory`. Follows links on the way to the bundle.
    static bool isUnchanged(int directory, const std::string& name, BundleKind kind, const BundleFacts& known,
                            Look look);

    /// A digest of the state of an open directory, which differs when another name came to be in it, or one went. 0
    /// when that cannot be told yet.
    static std::uint64_t listingEvidence(int directory);

private:
    class FileStates;
    /// A bundle by a path below an open directory, and by its name for `watch`.
    struct Place {
        int directory;
        const std::string& name; // empty for the open directory itself
        const std::string& path;
        std::string below(std::string_view file) const {
            std::string below;
            below.reserve(name.size() + 1 + file.size());
            if (!name.empty()) below.append(name).append(1, '/');
            below.append(file);
            return below;
        }
    };
    static bool isUnchanged(const Place& place, BundleKind kind, const BundleFacts& known, Look look,
                            const Watch& watch);
    /// Goes through the string tables, and with `content` appends what they contain to it. False without resources.
    static bool visitResources(const Place& place, const Watch& watch, FileStates& states, std::string* content);

    const Watch _watch;
    SharedStrings& _strings;
};

} // namespace platform::linux_
