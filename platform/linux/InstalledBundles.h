#pragma once

#include "platform/linux/BundleScanner.h"
#include "platform/linux/DescriptorStore.h"
#include "platform/linux/Registry.h"
#include "platform/linux/RegistryRecord.h"
#include "platform/linux/RegistryStore.h"
#include "platform/linux/RegistryWatcher.h"

#include <cstddef>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

namespace platform::linux_ {

/// Which applications and plug-ins are installed: kept in line with the disk, and in the database. For one thread.
class InstalledBundles {
public:
    /// What became different. A plug-in that was replaced is in both maps.
    struct Change {
        PlugIns removed;
        PlugIns installed;
        // Plug-ins that stay who they are with another content, which shows from one moment to the next: what they
        // were, and what they are.
        PlugIns replaced;
        PlugIns renewed;
        bool isChanged = false; // anything that the registry tells about anything
    };

    /// What was done since the start.
    enum class Stage {
        stored,   // nothing: what is known is what the database tells
        glanced,  // no plug-in came or went, and no manifest of one changed: what queries select by is true
        verified, // everything is true of the disk at the start, or later
        watched,  // and whatever changes is noticed
    };

    /// Reads the database, or if that tells nothing the disk. `root` has no symbolic links in it. `descriptors`, if
    /// any, keeps the watch, and may have kept one.
    InstalledBundles(const Root& root, const RegistryLimits& limits, DescriptorStore* descriptors);

    Stage stage() const { return _stage; }
    /// Whether the plug-in's bundle, and its application's, are still on disk as they were read: for one that is asked
    /// for before everything is verified. Any thread.
    bool isUnchanged(const InstalledPlugIn& plugIn) const;

    /// Readable when `catchUp` has something to do; negative when there is no such descriptor.
    int descriptor() const { return _watcher.descriptor(); }
    /// Takes in everything that happened on disk until now. Before that is watched, goes one stage further or more.
    Change catchUp();
    /// The last call: if the watch is kept, and all that was taken in is in the database, this is noted there, and the
    /// next start needs to look at the disk only if the watch has anything to tell. What was taken in after that would
    /// be hidden from it.
    void handOver();
    /// Something may have changed that `catchUp` does not hear of; `verify` finds it.
    bool needsVerifying() const {
        return _stage < Stage::verified || !_watcher.unwatched().empty() || !_incomplete.empty();
    }
    Change verify();

    using Tell = std::function<void(const Change&)>;
    /// `path` is canonical. False when no plug-in is registered there afterwards. Calls `tell` with each change.
    bool registerPlugIn(const std::string& path, const Tell& tell);
    /// False when none was registered there.
    bool unregisterPlugIn(const std::string& path, const Tell& tell);

    const PlugIns& plugIns() const { return _plugIns; }
    /// All but the plug-ins at the paths in `hidden`.
    Installed installed(const PlugIns& hidden = {});
    const Knowledge& knowledge() const { return _knowledge; }

private:
    using Places = std::set<std::string>;
    using Surroundings = std::map<std::string, std::string>; // a directory's path, and which one it is
    enum class FolderKind { applications, plugIns };
    struct Folder {
        std::string path;
        FolderKind kind;
    };
    struct FoundPlugIn {
        BundleFactsRef facts;
        std::optional<std::string> identifier;
        std::string application; // its path; empty outside applications
    };
    struct Found {
        std::map<std::string, BundleFactsRef> applications;
        std::map<std::string, FoundPlugIn> plugIns;
        Listings listings;
    };
    enum class Manifests { settled, maybeBeingWritten };

    // Where things lie.
    std::optional<std::string> placeInFolder(const Folder& folder, const std::string& path) const;
    bool isDiscovered(const std::string& path) const;
    void touch(const std::string& path, Places& places) const;

    // Comparing the disk with what is known.
    Places changedPlaces(Look look) const;
    std::vector<std::string> subfoldersOf(const std::string& prefix) const;
    void compareFolder(int directory, const Folder& folder, std::size_t depth, Look look, Places& changed) const;
    Change compare();

    // Reading the disk.
    Change rescan(Places places, Manifests manifests);
    void scanPlace(const std::string& place, Found& found);
    void scanFolder(int directory, const std::string& path, FolderKind kind, std::size_t depth, Found& found);
    void scanApplication(int directory, const std::string& path, Found& found);
    void scanPlugIn(int directory, const std::string& path, const std::string& application, Found& found);
    void scanRegistration(const std::string& path, Found& found);
    void watchPassage(const std::string& path, const std::string& top);
    Descriptor open(int parent, const std::string& name);
    Descriptor open(const std::string& path);
    std::vector<std::string> directoriesIn(int directory);
    BundleFactsRef accept(const std::string& path, const ScannedBundle& scanned, const BundleFactsRef& known);
    void refuse(const std::string& path, const std::string& reason);

    // Taking in what was found.
    Change takeIn(const Places& places, const Found& found);
    void takeInListings(const Places& places, const Found& found);
    bool takeInApplications(const Places& places, const Found& found);
    void takeInPlugIns(const Places& places, const Found& found, Change& change);
    bool repointPlugIns();
    void noteMoved(const std::vector<std::shared_ptr<InstalledPlugIn>>& added, Change& change) const;
    void identify(std::vector<std::shared_ptr<InstalledPlugIn>> added, const PlugIns& removed);
    bool isSaved() const;
    void save();

    // Between one process and the next.
    Surroundings surroundings(const Places& places) const;
    static std::string textOf(const Surroundings& surroundings);
    void takeOverWatch();

    const std::string _top;
    const std::vector<Folder> _folders;
    const RegistryLimits _limits;
    SharedStrings _strings;
    RegistryStore _store;
    DescriptorStore* const _descriptors;
    std::string _watchName; // under which the watch is kept; empty when nobody keeps it
    RegistryWatcher _watcher;
    BundleScanner _scanner;

    Applications _applications;
    PlugIns _plugIns;
    std::set<std::string> _registrations; // registered by path; installed or awaited
    Exclusions _exclusions;               // unregistered although they lie where plug-ins are looked for
    Listings _listings;
    Knowledge _knowledge;
    Stage _stage = Stage::stored;
    std::optional<Installed> _stored; // what was read from the database, until it is asked for or not true any more
    Surroundings _surroundings;       // as they were when they were last looked at

    Manifests _manifests = Manifests::settled;    // during a scan
    bool _isShort = false;                        // during a scan: something could not be looked at
    Places _incomplete;                           // places of scans that ran short
    std::set<std::string> _settledManifests;      // bundles whose manifest's writer is done
    std::map<std::string, std::string> _refusals; // by path; each reason is logged once
    bool _hasToldOfUnwatched = false;

    // What the database does not have yet. Kept when it cannot be written, and tried again with the next change.
    std::set<std::string> _unsavedApplications;
    std::set<std::string> _unsavedPlugIns;
    std::set<std::string> _unsavedRegistrations;
    std::set<std::string> _unsavedExclusions;
    std::set<std::string> _unsavedListings;
    std::vector<RemovedPlugIn> _unsavedRemoved;
    std::vector<UUID> _unsavedReturned; // removed plug-ins that came back
    bool _isKnowledgeUnsaved = false;
};

} // namespace platform::linux_
