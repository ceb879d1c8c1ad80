#include "platform/linux/InstalledBundles.h"

#include "platform/SystemLog.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/FileStatus.h"
#include "platform/linux/Mounts.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unordered_map>
#include <unordered_set>
#include <utility>

namespace platform::linux_ {

namespace {

constexpr std::string_view applicationSuffix = ".app";
/// Folders below an applications directory in which applications are looked for.
constexpr std::size_t maximumFolderDepth = 4;
/// Each registration by path is looked at with every change on disk.
constexpr std::size_t maximumRegistrations = 4096;
/// Every directory on the way to one is watched, and walking there takes time for each.
constexpr std::ptrdiff_t maximumRegistrationDepth = 64;
constexpr const char* everything = ""; // every path is below it
/// More places than these are found sooner on a walk through everything.
constexpr std::size_t maximumPlacesByPath = 1000;
/// What the names of kept watches begin with.
constexpr const char* watchPrefix = "catalix-";

LogHandle& cx() {
    // The log belongs to the process and is set before the first service is made.
    LogHandle* handle = systemLog().createHandle("com.nordane.Zembra", "cx");
    return handle != nullptr ? *handle : systemLog().defaultHandle();
}

Date now() { return Date{std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count()}; }

bool isApplicationName(std::string_view path) {
    const auto name = path.substr(path.rfind('/') + 1);
    return name.size() > applicationSuffix.size() && name.ends_with(applicationSuffix);
}

/// The directories above `path`, the nearest first, without "/".
std::vector<std::string> ancestors(std::string path) {
    std::vector<std::string> directories;
    while (true) {
        path.resize(path.rfind('/'));
        if (path.empty()) return directories;
        directories.push_back(path);
    }
}

/// The elements of a map by path that lie at or below `place`.
template <class Map> std::vector<std::string> pathsBelow(const Map& map, const std::string& place) {
    std::vector<std::string> paths;
    for (auto next = map.lower_bound(place); next != map.end() && next->first.starts_with(place); ++next) {
        if (isAtOrBelow(next->first, place)) paths.push_back(next->first);
    }
    return paths;
}

template <class Map> auto lookUp(const Map& map, const std::string& path) {
    const auto found = map.find(path);
    return found == map.end() ? typename Map::mapped_type() : found->second;
}

} // namespace

InstalledBundles::InstalledBundles(const Root& root, const RegistryLimits& limits, DescriptorStore* descriptors)
    : _top(root.directory()),
      _folders{{root.applications(), FolderKind::applications},
               {root.system() + "/Applications", FolderKind::applications},
               {root.system() + "/Library/PlugIns", FolderKind::plugIns}},
      _limits(limits),
      _store(root.database() + "/Catalix.sqlite", _strings),
      _descriptors(descriptors),
      _watcher(limits.watches),
      _scanner([this](int directory,
                      const std::string& path) { _watcher.watch(directory, path, RegistryWatcher::Role::content); },
               _strings) {
    std::optional<std::string> problem;
    auto contents = _store.open(problem);
    if (problem) cx().error("the registry's database was not usable: %{public}s", *problem);
    _applications = std::move(contents.applications);
    _plugIns = std::move(contents.plugIns);
    _stored = std::move(contents.inOrder);
    _registrations = std::move(contents.registrations);
    _exclusions = std::move(contents.exclusions);
    _listings = std::move(contents.listings);
    _isKnowledgeUnsaved = !contents.knowledge;
    _knowledge = contents.knowledge.value_or(Knowledge{UUID::random(), 1});
    auto kept = descriptors != nullptr ? descriptors->take(watchPrefix) : DescriptorStore::Kept();
    if (contents.handedOver && contents.handedOver->watch == kept.name &&
        contents.handedOver->places == textOf(surroundings({everything})) &&
        RegistryWatcher::isSilent(kept.descriptor.get())) {
        cx().info("nothing changed on disk while the daemon was not running");
        _watcher.become(std::move(kept.descriptor));
        _watchName = std::move(kept.name);
        _stage = Stage::verified;
    } else if (!kept.name.empty()) {
        descriptors->drop(kept.name); // with all that it watches, before the same is watched anew
    }
    if (!contents.knowledge) rescan({everything}, Manifests::settled);
}

Installed InstalledBundles::installed(const PlugIns& hidden) {
    // Walking through the maps takes far longer after a start: their nodes lie all over what was read.
    if (_stored && hidden.empty()) return *std::exchange(_stored, std::nullopt);
    Installed installed;
    installed.plugIns.reserve(_plugIns.size());
    for (const auto& [path, plugIn] : _plugIns) {
        if (!hidden.contains(path)) installed.plugIns.push_back(plugIn);
    }
    installed.applications.reserve(_applications.size());
    for (const auto& [path, application] : _applications) installed.applications.push_back(application);
    return installed;
}

/// Which directories are there now where bundles are looked for, at and below `places`: a watch does not hear that
/// others come to be there.
InstalledBundles::Surroundings InstalledBundles::surroundings(const Places& places) const {
    Surroundings found;
    const auto add = [&](const std::string& path) {
        if (std::ranges::none_of(places, [&](const auto& place) { return isAtOrBelow(path, place); })) return false;
        FileStatus status; // stays empty where there is none
        (void)readFileStatus(AT_FDCWD, path.c_str(), status);
        const auto& identity = status.identity;
        for (const auto part : {identity.device, identity.inode, static_cast<std::uint64_t>(identity.bornSeconds),
                                std::uint64_t{identity.bornNanoseconds}})
            found[path] += std::to_string(part) + ' ';
        return true;
    };
    for (const auto& folder : _folders) {
        if (add(folder.path)) found[folder.path] += mountsAtAndBelow(folder.path);
    }
    for (const auto& registration : _registrations) add(registration);
    return found;
}

std::string InstalledBundles::textOf(const Surroundings& surroundings) {
    std::string text;
    for (const auto& [path, state] : surroundings) text.append(path).append(": ").append(state).append("\n");
    return text;
}

/// Events are taken from now on, so what was handed over to this process holds for no later one.
void InstalledBundles::takeOverWatch() {
    const auto failure = _store.change([&] { _store.setHandedOver(std::nullopt); });
    if (failure && !_watchName.empty()) {
        // Then it stays true as it is: of a watch that nobody reads.
        _watcher.become({});
        _watchName.clear();
        return;
    }
    if (_descriptors == nullptr) return;
    // Under another name, so that no old copy of the database speaks of it.
    if (!_watchName.empty()) _descriptors->drop(_watchName);
    _watchName = watchPrefix + UUID::random().text();
    if (!_descriptors->keep(_watchName, _watcher.descriptor())) _watchName.clear();
}

void InstalledBundles::handOver() {
    if (_stage < Stage::watched || _watchName.empty() || !isSaved() || needsVerifying()) return;
    // Where something else came to lie meanwhile, other directories are watched than those that are there.
    if (surroundings({everything}) != _surroundings) return;
    // What happens from now on waits in the watch. Should this fail, the next start looks at everything.
    (void)_store.change([&] { _store.setHandedOver(HandedOver{_watchName, textOf(_surroundings)}); });
}

bool InstalledBundles::isUnchanged(const InstalledPlugIn& plugIn) const {
    const auto& application = plugIn.application;
    return BundleScanner::isUnchanged(plugIn.path, BundleKind::plugIn, *plugIn.facts) &&
           (!application ||
            BundleScanner::isUnchanged(application->path, BundleKind::application, *application->facts));
}

/// The application, the plug-in outside applications or the subfolder at or around `path`. None for what is no
/// bundle's business.
std::optional<std::string> InstalledBundles::placeInFolder(const Folder& folder, const std::string& path) const {
    if (!isAtOrBelow(path, folder.path) || path == folder.path) return std::nullopt;
    std::size_t end = folder.path.size();
    for (std::size_t depth = 0; depth <= maximumFolderDepth; ++depth) {
        if (path[end + 1] == '.') return std::nullopt; // hidden, as the unfinished copies of installers are
        end = std::min(path.find('/', end + 1), path.size());
        std::string place = path.substr(0, end);
        if (folder.kind == FolderKind::plugIns || isApplicationName(place) || end == path.size()) return place;
    }
    return std::nullopt;
}

bool InstalledBundles::isDiscovered(const std::string& path) const {
    const std::size_t slash = path.rfind('/');
    if (path.compare(slash + 1, 1, ".") == 0) return false;
    return std::ranges::any_of(_folders, [&](const Folder& folder) {
        const auto place = placeInFolder(folder, path);
        if (!place) return false;
        if (folder.kind == FolderKind::plugIns) return *place == path;
        return path.substr(0, slash) == *place + "/" + plugInsName;
    });
}

void InstalledBundles::touch(const std::string& path, Places& places) const {
    for (const auto& folder : _folders) {
        if (isAtOrBelow(folder.path, path)) places.insert(folder.path);
        if (auto place = placeInFolder(folder, path)) places.insert(*std::move(place));
    }
    for (const auto& registration : _registrations) {
        if (isAtOrBelow(registration, path) || isAtOrBelow(path, registration)) places.insert(registration);
        for (auto& directory : ancestors(registration)) {
            if (isApplicationName(directory) && isAtOrBelow(path, directory)) places.insert(std::move(directory));
        }
    }
}

InstalledBundles::Change InstalledBundles::catchUp() {
    if (_stage < Stage::verified) return compare();
    if (_stage < Stage::watched) return rescan({everything}, Manifests::settled);
    std::vector<RegistryWatcher::Event> events;
    if (!_watcher.read(events)) {
        cx().info("too many changes at once; looking at all bundles");
        return rescan({everything}, Manifests::settled);
    }
    Places places;
    for (const auto& event : events) {
        const std::string path = event.name.empty() ? event.directory : event.directory + "/" + event.name;
        // A file made just now is told again when its writer closes it. (One that was linked here is not, and is
        // not empty either.)
        struct stat status{};
        if ((event.mask & (IN_CREATE | IN_ISDIR)) == IN_CREATE && lstat(path.c_str(), &status) == 0 &&
            S_ISREG(status.st_mode) && status.st_size == 0)
            continue;
        if (event.name == manifestName) _settledManifests.insert(event.directory);
        touch(path, places);
    }
    auto change = rescan(std::move(places), Manifests::maybeBeingWritten);
    _settledManifests.clear();
    return change;
}

/// The places that are not as they are known, and those of which that cannot be told. Registrations are not compared.
InstalledBundles::Places InstalledBundles::changedPlaces(Look look) const {
    Places changed;
    for (const auto& folder : _folders) {
        if (const Descriptor directory = openDirectory(folder.path))
            compareFolder(directory.get(), folder, 0, look, changed);
        else if (isShortage(errno) || !pathsBelow(_applications, folder.path).empty() ||
                 !pathsBelow(_plugIns, folder.path).empty())
            changed.insert(folder.path);
    }
    return changed;
}

/// The names of the known folders in one, sorted.
std::vector<std::string> InstalledBundles::subfoldersOf(const std::string& prefix) const {
    std::vector<std::string> names;
    for (auto next = _listings.lower_bound(prefix); next != _listings.end() && next->first.starts_with(prefix);
         ++next) {
        if (next->first.find('/', prefix.size()) == std::string::npos)
            names.push_back(next->first.substr(prefix.size()));
    }
    return names;
}

void InstalledBundles::compareFolder(int directory, const Folder& folder, std::size_t depth, Look look,
                                     Places& changed) const {
    const std::string prefix = folder.path + "/";
    const std::uint64_t evidence = lookUp(_listings, folder.path);
    // Then all that is known is there, and beside it only subfolders: thousands of names need not be listed.
    const bool isAsKnown = evidence != 0 && evidence == BundleScanner::listingEvidence(directory);
    const auto listing = isAsKnown ? DirectoryListing{subfoldersOf(prefix), {}} : listDirectory(directory);
    if (!listing) {
        changed.insert(folder.path);
        return;
    }
    const auto& names = listing->directories;
    const auto compareUnknown = [&](const std::string& name) {
        const bool isPlain = folder.kind == FolderKind::applications && !isApplicationName(name);
        if (isPlain && depth >= maximumFolderDepth) return;
        const Descriptor subfolder = isPlain ? openDirectory(directory, name) : Descriptor();
        if (subfolder)
            compareFolder(subfolder.get(), {prefix + name, folder.kind}, depth + 1, look, changed);
        else
            changed.insert(prefix + name);
    };
    const auto compareAll = [&](const auto& allKnown, const auto& isUnchanged) {
        auto name = names.begin();
        for (auto known = allKnown.lower_bound(prefix); known != allKnown.end() && known->first.starts_with(prefix);
             ++known) {
            if (look == Look::cursory && !changed.empty()) return; // it takes a thorough look anyway
            const auto rest = std::string_view(known->first).substr(prefix.size());
            if (const auto slash = rest.find('/'); slash != std::string_view::npos) {
                const auto subfolder = rest.substr(0, slash);
                if (!std::ranges::binary_search(names, subfolder)) changed.insert(prefix + std::string(subfolder));
                continue;
            }
            while (name != names.end() && *name < rest) compareUnknown(*name++);
            const bool isListed = name != names.end() && *name == rest;
            if (isListed) ++name;
            if (!(isListed || isAsKnown) || !isUnchanged(std::string(rest), *known->second))
                changed.insert(known->first);
        }
        while (name != names.end()) compareUnknown(*name++);
    };
    if (folder.kind == FolderKind::plugIns) {
        compareAll(_plugIns, [&](const std::string& name, const InstalledPlugIn& plugIn) {
            return BundleScanner::isUnchanged(directory, name, BundleKind::plugIn, *plugIn.facts, look);
        });
        return;
    }
    auto plugIn = _plugIns.lower_bound(prefix);
    compareAll(_applications, [&](const std::string& name, const InstalledApplication& application) {
        if (!BundleScanner::isUnchanged(directory, name, BundleKind::application, *application.facts, look))
            return false;
        const std::string below = application.path + "/";
        // Nearly always they follow those of the application before.
        if (plugIn == _plugIns.end() || !plugIn->first.starts_with(below)) plugIn = _plugIns.lower_bound(below);
        for (; plugIn != _plugIns.end() && plugIn->first.starts_with(below); ++plugIn) {
            const std::string relative = plugIn->first.substr(prefix.size());
            const auto& facts = *plugIn->second->facts;
            if (!BundleScanner::isUnchanged(directory, relative, BundleKind::plugIn, facts, look)) return false;
        }
        return true;
    });
}

/// Compares the disk with what is known, in as few system calls as there may be, for everyone waits.
InstalledBundles::Change InstalledBundles::compare() {
    // Few have registrations; what lies around these is looked at as always.
    if (_stage == Stage::stored && _registrations.empty() && changedPlaces(Look::cursory).empty()) {
        _stage = Stage::glanced;
        return {};
    }
    Places changed = changedPlaces(Look::thorough);
    if (changed.size() > maximumPlacesByPath) return rescan({everything}, Manifests::settled);
    for (const auto& registration : _registrations) {
        for (auto& directory : ancestors(registration)) {
            if (isApplicationName(directory)) changed.insert(std::move(directory));
        }
        changed.insert(registration);
    }
    auto change = rescan(std::move(changed), Manifests::settled);
    _stage = Stage::verified;
    return change;
}

InstalledBundles::Change InstalledBundles::verify() {
    if (_stage < Stage::watched) return catchUp();
    Places places = _incomplete;
    for (const auto& directory : _watcher.unwatched()) touch(directory, places);
    return rescan(std::move(places), Manifests::settled);
}

bool InstalledBundles::registerPlugIn(const std::string& path, const Tell& tell) {
    if (_exclusions.erase(path) > 0) _unsavedExclusions.insert(path);
    Places places;
    touch(path, places);
    tell(rescan(std::move(places), Manifests::maybeBeingWritten));
    // One that lies where plug-ins are looked for comes and goes with its bundle and needs no registration.
    if (_plugIns.contains(path)) return true;
    if (_registrations.size() >= maximumRegistrations) {
        cx().error("too many plug-ins are registered by path");
        return false;
    }
    if (std::ranges::count(path, '/') > maximumRegistrationDepth) {
        cx().error("the plug-in at %@ lies too deep to be followed", path);
        return false;
    }
    if (!_registrations.insert(path).second) return false; // awaited, and still not there
    _unsavedRegistrations.insert(path);
    tell(rescan({path}, Manifests::maybeBeingWritten));
    if (_plugIns.contains(path)) return true;
    _registrations.erase(path);
    _unsavedRegistrations.insert(path);
    save();
    tell(rescan({path}, Manifests::maybeBeingWritten)); // gives up what the search watches
    return false;
}

bool InstalledBundles::unregisterPlugIn(const std::string& path, const Tell& tell) {
    const auto plugIn = lookUp(_plugIns, path);
    const bool wasRegistered = _registrations.erase(path) > 0;
    if (wasRegistered) _unsavedRegistrations.insert(path);
    if (plugIn && isDiscovered(path)) {
        _exclusions[path] = plugIn->facts->identity;
        _unsavedExclusions.insert(path);
    }
    if (!plugIn && !wasRegistered) return false;
    tell(rescan({path}, Manifests::maybeBeingWritten));
    return true;
}

InstalledBundles::Change InstalledBundles::rescan(Places places, Manifests manifests) {
    // A place within another one is seen to with that one.
    const Places all = places;
    std::erase_if(places, [&](const auto& place) {
        if (place == everything) return false;
        return all.contains(everything) ||
               std::ranges::any_of(ancestors(place), [&](const auto& directory) { return all.contains(directory); });
    });
    if (places.contains(everything)) {
        if (_stage < Stage::watched) takeOverWatch();
        _stage = Stage::watched;
    }
    std::erase_if(_surroundings, [&](const auto& known) {
        return std::ranges::any_of(places, [&](const auto& place) { return isAtOrBelow(known.first, place); });
    });
    _surroundings.merge(surroundings(places));
    _manifests = manifests;
    _isShort = false;
    Found found;
    _watcher.beginRound(places);
    for (const auto& place : places) scanPlace(place, found);
    if (_isShort) {
        // Nothing may go for the reason that it could not be looked at.
        cx().error("short of descriptors or memory; bundles are looked at again later");
        _incomplete.insert(places.begin(), places.end());
        places.clear();
        found.listings.clear(); // they may be incomplete
    } else {
        _watcher.endRound(places);
        for (const auto& place : places) _incomplete.erase(place);
    }
    const bool isUnwatched = !_watcher.unwatched().empty();
    if (isUnwatched && !_hasToldOfUnwatched)
        cx().error("cannot watch %lu directories; raise fs.inotify.max_user_watches", _watcher.unwatched().size());
    _hasToldOfUnwatched = isUnwatched;
    auto change = takeIn(places, found);
    if (change.isChanged) _stored.reset();
    save();
    return change;
}

void InstalledBundles::scanPlace(const std::string& place, Found& found) {
    for (const auto& folder : _folders) {
        if (isAtOrBelow(folder.path, place)) {
            watchPassage(folder.path, _top);
            if (const Descriptor directory = open(folder.path))
                scanFolder(directory.get(), folder.path, folder.kind, 0, found);
        } else if (const auto inFolder = placeInFolder(folder, place)) {
            const Descriptor directory = open(*inFolder);
            if (!directory) continue;
            const auto depth =
                std::count(inFolder->begin() + static_cast<std::ptrdiff_t>(folder.path.size()), inFolder->end(), '/');
            if (folder.kind == FolderKind::plugIns)
                scanPlugIn(directory.get(), *inFolder, {}, found);
            else if (isApplicationName(*inFolder))
                scanApplication(directory.get(), *inFolder, found);
            else
                scanFolder(directory.get(), *inFolder, folder.kind, static_cast<std::size_t>(depth), found);
        }
    }
    for (auto next = _registrations.lower_bound(place); next != _registrations.end() && next->starts_with(place);
         ++next) {
        if (isAtOrBelow(*next, place) && !found.plugIns.contains(*next)) scanRegistration(*next, found);
    }
}

void InstalledBundles::scanFolder(int directory, const std::string& path, FolderKind kind, std::size_t depth,
                                  Found& found) {
    _watcher.watch(directory, path, RegistryWatcher::Role::content);
    const std::uint64_t evidence = BundleScanner::listingEvidence(directory);
    bool isEachKnown = true;
    for (const auto& name : directoriesIn(directory)) {
        const Descriptor entry = open(directory, name);
        const std::string entryPath = path + "/" + name;
        if (!entry) {
            isEachKnown = false;
        } else if (kind == FolderKind::plugIns) {
            scanPlugIn(entry.get(), entryPath, {}, found);
        } else if (isApplicationName(entryPath)) {
            scanApplication(entry.get(), entryPath, found);
            isEachKnown = isEachKnown && found.applications.contains(entryPath);
        } else if (depth < maximumFolderDepth) {
            scanFolder(entry.get(), entryPath, kind, depth + 1, found);
        }
    }
    if (kind == FolderKind::applications) found.listings[path] = isEachKnown ? evidence : 0;
}

void InstalledBundles::scanApplication(int directory, const std::string& path, Found& found) {
    const auto known = lookUp(_applications, path);
    const auto knownFacts = known ? known->facts : nullptr;
    const auto scanned = _scanner.scan(directory, path, BundleKind::application, knownFacts);
    const auto facts = accept(path, scanned, knownFacts);
    if (!facts) return;
    _refusals.erase(path);
    found.applications[path] = facts;
    const Descriptor plugIns = open(directory, plugInsName);
    if (!plugIns) return;
    const std::string plugInsPath = path + "/" + plugInsName;
    bool isEachKnown = true;
    _watcher.watch(plugIns.get(), plugInsPath, RegistryWatcher::Role::content);
    for (const auto& name : directoriesIn(plugIns.get())) {
        const std::string plugInPath = plugInsPath + "/" + name;
        if (const Descriptor plugIn = open(plugIns.get(), name)) scanPlugIn(plugIn.get(), plugInPath, path, found);
        isEachKnown = isEachKnown && (found.plugIns.contains(plugInPath) || _exclusions.contains(plugInPath));
    }
    if (isEachKnown) return;
    // Another directory there may become a plug-in, and the folder would not tell.
    if (facts == knownFacts && facts->evidence != 0) _unsavedApplications.insert(path);
    facts->evidence = 0;
}

void InstalledBundles::scanPlugIn(int directory, const std::string& path, const std::string& application,
                                  Found& found) {
    const auto known = lookUp(_plugIns, path);
    const auto knownFacts = known ? known->facts : nullptr;
    const auto scanned = _scanner.scan(directory, path, BundleKind::plugIn, knownFacts);
    if (const auto exclusion = _exclusions.find(path); exclusion != _exclusions.end()) {
        if (exclusion->second == scanned.identity) return;
        _exclusions.erase(exclusion); // another bundle took the place of the one that was not wanted
        _unsavedExclusions.insert(path);
    }
    const auto facts = accept(path, scanned, knownFacts);
    if (!facts) return;
    if (facts == knownFacts) {
        found.plugIns[path] = {facts, known->identifier, application};
        return;
    }
    auto dictionary = facts->info->find({"VKExtension"}).dictionary();
    if (!dictionary) dictionary = facts->info->find({"Zembra"}).dictionary();
    if (!dictionary) return; // a bundle of another kind
    Value identifierValue = (*dictionary)["VKExtensionIdentifier"];
    if (!identifierValue.string()) identifierValue = facts->info->find({"VBBundleIdentifier"});
    std::optional<std::string> identifier;
    if (const auto text = identifierValue.string()) identifier = *text;
    // It names directories, and stands in logs. (A plug-in without any is left to the daemon, which says so.)
    if (identifier && !isFileName(*identifier)) return refuse(path, "unusable identifier");
    _refusals.erase(path);
    found.plugIns[path] = {facts, std::move(identifier), application};
}

void InstalledBundles::scanRegistration(const std::string& path, Found& found) {
    watchPassage(path, {});
    const Descriptor directory = open(path);
    if (!directory) return; // awaited
    std::string application;
    for (const auto& candidate : ancestors(path)) {
        if (!isApplicationName(candidate)) continue;
        const Descriptor around = open(candidate);
        if (!around) continue;
        const auto known = lookUp(_applications, candidate);
        const auto knownFacts = known ? known->facts : nullptr;
        const auto scanned = _scanner.scan(around.get(), candidate, BundleKind::application, knownFacts);
        const auto facts = accept(candidate, scanned, knownFacts);
        if (!facts) continue;
        if (facts != knownFacts) facts->evidence = 0; // the other plug-ins in it were not looked at
        found.applications[candidate] = facts;
        application = candidate;
        break;
    }
    scanPlugIn(directory.get(), path, application, found);
}

/// Watches the directories above `path` that exist, up to `top`, for entries that come and go.
void InstalledBundles::watchPassage(const std::string& path, const std::string& top) {
    for (const auto& ancestor : ancestors(path)) {
        if (!isAtOrBelow(ancestor, top)) return;
        if (const Descriptor directory = open(ancestor))
            _watcher.watch(directory.get(), ancestor, RegistryWatcher::Role::passage);
    }
    if (!top.empty()) return;
    if (const Descriptor directory = open("/")) _watcher.watch(directory.get(), "", RegistryWatcher::Role::passage);
}

Descriptor InstalledBundles::open(int parent, const std::string& name) {
    Descriptor directory = openDirectory(parent, name);
    if (!directory && isShortage(errno)) _isShort = true;
    return directory;
}

Descriptor InstalledBundles::open(const std::string& path) {
    Descriptor directory = openDirectory(path);
    if (!directory && isShortage(errno)) _isShort = true;
    return directory;
}

std::vector<std::string> InstalledBundles::directoriesIn(int directory) {
    auto listing = listDirectory(directory);
    if (!listing && isShortage(errno)) _isShort = true;
    return std::move(listing).value_or(DirectoryListing()).directories;
}

/// The facts that hold from now on; null when there is no usable bundle.
BundleFactsRef InstalledBundles::accept(const std::string& path, const ScannedBundle& scanned,
                                        const BundleFactsRef& known) {
    using State = ScannedBundle::State;
    if (scanned.state == State::unusable || scanned.state == State::unfinished) {
        // The manifest of a known bundle may be half written; its writer's close will be told.
        const bool isSettled = _manifests == Manifests::settled || _settledManifests.contains(path);
        if (!isSettled && known && known->identity == scanned.identity) return known;
        if (scanned.state == State::unusable) refuse(path, scanned.reason);
        return nullptr;
    }
    if (scanned.state == State::unknown) {
        _isShort = true;
        return known;
    }
    return scanned.facts;
}

void InstalledBundles::refuse(const std::string& path, const std::string& reason) {
    auto& last = _refusals[path];
    if (last == reason) return;
    last = reason;
    cx().error("ignoring bundle at %{public}s: %{public}s", path, reason);
}

InstalledBundles::Change InstalledBundles::takeIn(const Places& places, const Found& found) {
    for (const auto& place : places) {
        // A reason is worth a line again when another bundle comes to the place of one that went.
        for (const auto& path : pathsBelow(_refusals, place)) {
            struct stat status{};
            if (lstat(path.c_str(), &status) != 0) _refusals.erase(path);
        }
        for (const auto& path : pathsBelow(_exclusions, place)) {
            struct stat status{};
            if (lstat(path.c_str(), &status) == 0 || errno != ENOENT) continue;
            _exclusions.erase(path);
            _unsavedExclusions.insert(path);
        }
    }
    takeInListings(places, found);
    Change change;
    change.isChanged = takeInApplications(places, found);
    takeInPlugIns(places, found, change);
    if (repointPlugIns()) change.isChanged = true;
    if (change.isChanged) {
        // A change with both is told in two steps, and so is a state of its own in between.
        const bool isTwoSteps = !change.removed.empty() && !change.installed.empty();
        _knowledge = {UUID::random(), _knowledge.sequence + (isTwoSteps ? 2 : 1)};
        _isKnowledgeUnsaved = true;
    }
    return change;
}

void InstalledBundles::takeInListings(const Places& places, const Found& found) {
    for (const auto& place : places) {
        for (const auto& path : pathsBelow(_listings, place)) {
            if (found.listings.contains(path)) continue;
            _listings.erase(path);
            _unsavedListings.insert(path);
        }
    }
    for (const auto& [path, evidence] : found.listings) {
        const auto [known, isNew] = _listings.try_emplace(path, evidence);
        if (isNew || std::exchange(known->second, evidence) != evidence) _unsavedListings.insert(path);
    }
}

bool InstalledBundles::takeInApplications(const Places& places, const Found& found) {
    bool isChanged = false;
    for (const auto& place : places) {
        for (const auto& path : pathsBelow(_applications, place)) {
            if (found.applications.contains(path)) continue;
            _applications.erase(path);
            _unsavedApplications.insert(path);
            isChanged = true;
        }
    }
    for (const auto& [path, facts] : found.applications) {
        auto& application = _applications[path];
        if (application && application->facts->identity == facts->identity &&
            application->facts->fingerprint == facts->fingerprint) {
            if (application->facts->evidence != facts->evidence) _unsavedApplications.insert(path);
            application->facts->evidence = facts->evidence.load();
            continue;
        }
        application = std::make_shared<const InstalledApplication>(InstalledApplication{path, facts, {}});
        _unsavedApplications.insert(path);
        isChanged = true;
    }
    return isChanged;
}

void InstalledBundles::takeInPlugIns(const Places& places, const Found& found, Change& change) {
    for (const auto& place : places) {
        for (const auto& path : pathsBelow(_plugIns, place)) {
            if (!found.plugIns.contains(path)) change.removed.emplace(path, _plugIns[path]);
        }
    }
    std::vector<std::shared_ptr<InstalledPlugIn>> added;
    for (const auto& [path, seen] : found.plugIns) {
        const auto known = lookUp(_plugIns, path);
        const auto application = lookUp(_applications, seen.application);
        const bool isSame =
            known && known->facts->identity == seen.facts->identity && known->identifier == seen.identifier;
        if (isSame && known->facts->fingerprint == seen.facts->fingerprint && known->application == application) {
            if (known->facts->evidence != seen.facts->evidence) _unsavedPlugIns.insert(path);
            known->facts->evidence = seen.facts->evidence.load();
            continue;
        }
        auto plugIn = std::make_shared<InstalledPlugIn>();
        plugIn->path = path;
        plugIn->identifier = seen.identifier;
        plugIn->application = application;
        plugIn->facts = seen.facts;
        if (isSame) {
            plugIn->uuid = known->uuid;
            plugIn->originalIdentifier = known->originalIdentifier;
            plugIn->registered = known->registered;
            if (known->facts->fingerprint != seen.facts->fingerprint) {
                change.replaced.emplace(path, known);
                change.renewed.emplace(path, plugIn);
            }
            _plugIns[path] = std::move(plugIn);
            _unsavedPlugIns.insert(path);
            change.isChanged = true;
            continue;
        }
        if (known) change.removed.emplace(path, known);
        added.push_back(std::move(plugIn));
    }
    noteMoved(added, change);
    for (const auto& [path, plugIn] : change.removed) {
        _plugIns.erase(path);
        _unsavedPlugIns.insert(path);
    }
    identify(added, change.removed);
    for (const auto& plugIn : added) {
        _plugIns[plugIn->path] = plugIn;
        _unsavedPlugIns.insert(plugIn->path);
        change.installed.emplace(plugIn->path, plugIn);
    }
    if (!change.removed.empty() || !change.installed.empty()) change.isChanged = true;

    // An application that is known for a plug-in registered by path goes with the last of them.
    for (const auto& [path, plugIn] : change.removed) {
        if (!plugIn->application || !_applications.contains(plugIn->application->path)) continue;
        const std::string& application = plugIn->application->path;
        const bool isInFolder = std::ranges::any_of(
            _folders, [&](const Folder& folder) { return placeInFolder(folder, application) == application; });
        if (isInFolder || !pathsBelow(_plugIns, application).empty()) continue;
        _applications.erase(application);
        _unsavedApplications.insert(application);
    }
}

/// A directory that is moved while its folder is read shows at both places; then the old one is gone by now, and its
/// plug-ins go in the same change, so that the new ones are known for who they were.
void InstalledBundles::noteMoved(const std::vector<std::shared_ptr<InstalledPlugIn>>& added, Change& change) const {
    std::unordered_set<std::uint64_t> inodes;
    for (const auto& plugIn : added) inodes.insert(plugIn->facts->identity.inode);
    if (inodes.empty()) return;
    for (const auto& [path, plugIn] : _plugIns) {
        struct stat status{};
        if (!inodes.contains(plugIn->facts->identity.inode) || lstat(path.c_str(), &status) == 0) continue;
        if (errno == ENOENT) change.removed.emplace(path, plugIn);
    }
}

/// Gives every plug-in the application that is known now. True when one had another one.
bool InstalledBundles::repointPlugIns() {
    bool isChanged = false;
    for (const auto& path : _unsavedApplications) {
        const auto application = lookUp(_applications, path);
        for (const auto& plugInPath : pathsBelow(_plugIns, path)) {
            auto& plugIn = _plugIns[plugInPath];
            if (!plugIn->application || plugIn->application->path != path || plugIn->application == application)
                continue;
            // By name: what readers made of the old one is theirs, under a lock of theirs.
            plugIn = std::make_shared<InstalledPlugIn>(InstalledPlugIn{
                .path = plugIn->path,
                .uuid = plugIn->uuid,
                .identifier = plugIn->identifier,
                .originalIdentifier = plugIn->originalIdentifier,
                .registered = plugIn->registered,
                .application = application,
                .facts = plugIn->facts,
                .proxy = {},
            });
            _unsavedPlugIns.insert(plugInPath);
            isChanged = true;
        }
    }
    return isChanged;
}

/// Finds for each added plug-in who it was before: the same directory, wherever it was, or else the same identifier
/// at the same place.
void InstalledBundles::identify(std::vector<std::shared_ptr<InstalledPlugIn>> added, const PlugIns& removed) {
    if (added.empty() && removed.empty()) return;
    const Date date = now();
    for (const auto& plugIn : added) {
        plugIn->uuid = UUID::random();
        plugIn->originalIdentifier = plugIn->identifier;
        plugIn->registered = date;
    }
    const auto isSameDirectory = [](const InstalledPlugIn& plugIn, const RemovedPlugIn& before) {
        const bool isSame = before.identity == plugIn.facts->identity;
        return isSame && (before.identifier == plugIn.identifier || before.path == plugIn.path);
    };
    const auto isSamePlace = [](const InstalledPlugIn& plugIn, const RemovedPlugIn& before) {
        return before.path == plugIn.path && before.identifier == plugIn.identifier;
    };
    const auto become = [](InstalledPlugIn& plugIn, const RemovedPlugIn& before) {
        plugIn.uuid = before.uuid;
        plugIn.originalIdentifier = before.originalIdentifier;
    };

    PlugIns gone = removed; // without those that are back under another path or as another bundle
    std::unordered_multimap<std::uint64_t, std::string> goneByInode; // thousands move when a folder above them does
    for (const auto& [path, plugIn] : gone) goneByInode.emplace(plugIn->facts->identity.inode, path);
    const auto asRemoved = [](const InstalledPlugIn& plugIn) {
        return RemovedPlugIn{plugIn.path, plugIn.uuid, plugIn.identifier, plugIn.originalIdentifier,
                             plugIn.facts->identity};
    };
    const auto takeFrom = [&](const auto& pathsFor, const auto& isSame) {
        std::erase_if(added, [&](const auto& plugIn) {
            for (const auto& path : pathsFor(*plugIn)) {
                const auto candidate = gone.find(path);
                if (candidate == gone.end()) continue;
                const auto before = asRemoved(*candidate->second);
                if (!isSame(*plugIn, before)) continue;
                become(*plugIn, before);
                gone.erase(candidate);
                return true;
            }
            return false;
        });
    };
    takeFrom(
        [&](const InstalledPlugIn& plugIn) {
            std::set<std::string> paths;
            const auto [begin, end] = goneByInode.equal_range(plugIn.facts->identity.inode);
            for (auto next = begin; next != end; ++next) paths.insert(next->second);
            return paths;
        },
        isSameDirectory);
    takeFrom([](const InstalledPlugIn& plugIn) { return std::array{plugIn.path}; }, isSamePlace);

    std::unordered_set<UUID> inUse; // one directory may be met at two paths while it moves
    for (const auto& plugIn : added) {
        const auto candidates = _store.removedPlugIns(plugIn->facts->identity, plugIn->path);
        auto before = std::ranges::find_if(candidates, [&](const auto& one) { return isSameDirectory(*plugIn, one); });
        if (before == candidates.end())
            before = std::ranges::find_if(candidates, [&](const auto& one) { return isSamePlace(*plugIn, one); });
        if (before == candidates.end()) continue;
        if (inUse.empty()) {
            for (const auto& [path, known] : _plugIns) inUse.insert(known->uuid);
        }
        if (!inUse.insert(before->uuid).second) continue;
        become(*plugIn, *before);
        _unsavedReturned.push_back(before->uuid);
    }
    for (const auto& [path, plugIn] : gone) _unsavedRemoved.push_back(asRemoved(*plugIn));
}

bool InstalledBundles::isSaved() const {
    return _unsavedApplications.empty() && _unsavedPlugIns.empty() && _unsavedRegistrations.empty() &&
           _unsavedExclusions.empty() && _unsavedListings.empty() && !_isKnowledgeUnsaved;
}

void InstalledBundles::save() {
    if (isSaved()) return;
    const auto failure = _store.change([&] {
        for (const auto& path : _unsavedApplications) {
            if (const auto application = lookUp(_applications, path))
                _store.put(*application);
            else
                _store.removeApplication(path);
        }
        // First the rows that go, for another path may have taken over their UUIDs.
        for (const auto& path : _unsavedPlugIns) _store.removePlugIn(path);
        for (const auto& path : _unsavedPlugIns) {
            if (const auto plugIn = lookUp(_plugIns, path)) _store.put(*plugIn);
        }
        for (const auto& path : _unsavedRegistrations) _store.setRegistered(path, _registrations.contains(path));
        for (const auto& path : _unsavedExclusions) {
            const auto exclusion = _exclusions.find(path);
            _store.setExcluded(path, exclusion == _exclusions.end() ? std::nullopt : std::optional(exclusion->second));
        }
        for (const auto& path : _unsavedListings) {
            const auto listing = _listings.find(path);
            _store.setListing(path, listing == _listings.end() ? std::nullopt : std::optional(listing->second));
        }
        _store.setHandedOver(std::nullopt);
        for (const auto& removed : _unsavedRemoved) _store.remember(removed);
        for (const auto& uuid : _unsavedReturned) _store.forget(uuid);
        if (!_unsavedRemoved.empty()) _store.keepRemoved(_limits.removedPlugIns);
        if (_isKnowledgeUnsaved) _store.setKnowledge(_knowledge);
    });
    if (failure) {
        cx().error("the registry's changes could not be stored: %{public}@", *failure);
        const std::size_t excess = _unsavedRemoved.size() - std::min(_unsavedRemoved.size(), _limits.removedPlugIns);
        _unsavedRemoved.erase(_unsavedRemoved.begin(), _unsavedRemoved.begin() + static_cast<std::ptrdiff_t>(excess));
        return;
    }
    _unsavedApplications.clear();
    _unsavedPlugIns.clear();
    _unsavedRegistrations.clear();
    _unsavedExclusions.clear();
    _unsavedListings.clear();
    _unsavedRemoved.clear();
    _unsavedReturned.clear();
    _isKnowledgeUnsaved = false;
}

} // namespace platform::linux_
