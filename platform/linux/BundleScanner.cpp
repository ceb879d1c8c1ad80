#include "platform/linux/BundleScanner.h"

#include "platform/Hashing.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/Entitlements.h"

#include <algorithm>
#include <array>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <functional>
#include <sys/stat.h>

namespace platform::linux_ {

namespace {

constexpr std::int64_t nanoseconds = 1'000'000'000;

std::int64_t inNanoseconds(const statx_timestamp& time) { return time.tv_sec * nanoseconds + time.tv_nsec; }

std::uint64_t digest(std::string_view bytes) {
    const std::string hash = sha1(bytes);
    std::uint64_t value = 0;
    std::memcpy(&value, hash.data(), sizeof value);
    return std::max<std::uint64_t>(value, 1); // 0 stands for "none"
}

/// Takes off `left` the values in `value`, itself included. False when there are more.
// NOLINTNEXTLINE(misc-no-recursion): decoders bound the nesting.
bool takeValues(std::size_t& left, const Value& value) {
    if (left == 0) return false;
    --left;
    if (const auto array = value.array())
        return std::ranges::all_of(*array, [&](const Value& element) { return takeValues(left, element); });
    if (const auto dictionary = value.dictionary())
        return std::ranges::all_of(*dictionary, [&](const auto& entry) { return takeValues(left, entry.value); });
    return true;
}

/// Now, by the clock that files are stamped with.
std::int64_t fileClock() {
    timespec now{};
    clock_gettime(CLOCK_REALTIME_COARSE, &now);
    return now.tv_sec * nanoseconds + now.tv_nsec;
}

} // namespace

/// The states of the files of one bundle. Made before anything is read, so that whatever changes meanwhile counts as
/// recent and is read again another time.
class BundleScanner::FileStates {
public:
    /// Of the file at `path` below `directory`, or of `directory` itself when that is empty.
    DirectoryIdentity add(Look look, int directory, const std::string& path) {
        std::uint64_t& states = look == Look::cursory ? _cursory : _others;
        constexpr int flags = AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT | AT_EMPTY_PATH;
        struct statx status{};
        if (statx(directory, path.c_str(), flags, STATX_BASIC_STATS | STATX_BTIME, &status) != 0) {
            mix(states, "absent");
            return {};
        }
        const DirectoryIdentity identity{(std::uint64_t{status.stx_dev_major} << 32U) | status.stx_dev_minor,
                                         status.stx_ino,
                                         (status.stx_mask & STATX_BTIME) != 0 ? inNanoseconds(status.stx_btime) : 0};
        const std::int64_t changed = inNanoseconds(status.stx_ctime);
        const std::array state{identity.device,
                               identity.inode,
                               static_cast<std::uint64_t>(identity.birth),
                               std::uint64_t{status.stx_size},
                               static_cast<std::uint64_t>(inNanoseconds(status.stx_mtime)),
                               static_cast<std::uint64_t>(changed)};
        mix(states, {reinterpret_cast<const char*>(state.data()), sizeof state});
        // A file that changes twice within one tick of its clock shows one time for both. Whole seconds are the ticks
        // of old file systems.
        const std::int64_t tick = changed % nanoseconds == 0 ? 2 * nanoseconds : nanoseconds / 10;
        if (changed > _start - tick) _isRecent = true;
        return identity;
    }

    /// Of a string table in `directory`, whose own state, which would tell of another name, is not looked at.
    void addTable(int directory, const std::string& name) {
        add(Look::thorough, directory, name);
        mix(_others, name);
    }

    /// Of what every bundle of that kind has. Answers the identity of the bundle's directory.
    DirectoryIdentity addBundle(const Place& place, BundleKind kind) {
        addWhatIsChosenFrom(place, kind);
        if (kind == BundleKind::application) add(Look::thorough, place.directory, place.below(manifestName));
        return add(Look::thorough, place.directory, place.name);
    }
    void addWhatIsChosenFrom(const Place& place, BundleKind kind) {
        add(Look::cursory, place.directory, place.below(kind == BundleKind::plugIn ? manifestName : plugInsName));
    }

    /// As `BundleFacts::evidence`.
    std::uint64_t evidence() const {
        if (_isRecent) return 0;
        return std::max<std::uint64_t>((_cursory << 32U) | (_others & 0xffff'ffffU), 1);
    }

    bool agreesWith(std::uint64_t evidence, Look look) const {
        if (_isRecent) return false;
        return look == Look::thorough ? evidence == this->evidence() : evidence >> 32U == (_cursory & 0xffff'ffffU);
    }

private:
    // Not `digest`: tens of thousands are made at a start. One that another release hashed otherwise is no harm, for
    // then the bundle is read again.
    static void mix(std::uint64_t& states, std::string_view state) {
        states = states * 0x9e37'79b9'7f4a'7c15 + std::hash<std::string_view>()(state);
    }

    const std::int64_t _start = fileClock();
    std::uint64_t _cursory = 0; // digests
    std::uint64_t _others = 0;
    bool _isRecent = false;
};

bool BundleScanner::visitResources(const Place& place, const Watch& watch, FileStates& states, std::string* content) {
    const Descriptor resources = openDirectory(place.directory, place.below(resourcesName));
    if (!resources) return false;
    const std::string resourcesPath = place.path + "/" + resourcesName;
    watch(resources.get(), resourcesPath);
    auto languages = listDirectory(resources.get()).value_or(DirectoryListing()).directories;
    if (languages.size() > maximumResourceEntries) languages.resize(maximumResourceEntries);
    for (const auto& language : languages) {
        const Descriptor folder = openDirectory(resources.get(), language);
        if (!folder) continue;
        watch(folder.get(), resourcesPath + "/" + language);
        auto tables = listDirectory(folder.get()).value_or(DirectoryListing()).others;
        std::erase_if(tables, [](const auto& name) { return !name.ends_with(tableSuffix); });
        if (tables.size() > maximumResourceEntries) tables.resize(maximumResourceEntries);
        for (const auto& table : tables) {
            states.addTable(folder.get(), table);
            if (content == nullptr) continue;
            *content += language + "/" + table + "=";
            if (content->size() >= maximumTablesSize) continue;
            const auto bytes = readFile(folder.get(), table, maximumManifestSize);
            if (bytes && *bytes) *content += **bytes;
        }
    }
    return true;
}

bool BundleScanner::isUnchanged(const Place& place, BundleKind kind, const BundleFacts& known, Look look,
                                const Watch& watch) {
    const std::uint64_t evidence = known.evidence;
    if (evidence == 0) return false;
    FileStates states;
    if (look == Look::cursory) {
        states.addWhatIsChosenFrom(place, kind);
        return states.agreesWith(evidence, look);
    }
    const bool isSameDirectory = states.addBundle(place, kind) == known.identity;
    if (!known.executable.empty()) states.add(look, place.directory, place.below(known.executable));
    // Where none were, the directory's own state tells that there are none.
    if (known.hasResources) visitResources(place, watch, states, nullptr);
    return isSameDirectory && states.agreesWith(evidence, look);
}

bool BundleScanner::isUnchanged(int directory, const std::string& name, BundleKind kind, const BundleFacts& known,
                                Look look) {
    return isUnchanged({directory, name, name}, kind, known, look, [](int, const std::string&) {});
}

bool BundleScanner::isUnchanged(const std::string& path, BundleKind kind, const BundleFacts& known) {
    const Descriptor directory = openDirectory(path);
    return directory && isUnchanged({directory.get(), std::string(), path}, kind, known, Look::thorough,
                                    [](int, const std::string&) {});
}

std::uint64_t BundleScanner::listingEvidence(int directory) {
    FileStates states;
    states.add(Look::cursory, directory, {});
    return states.evidence();
}

ScannedBundle BundleScanner::scan(int directory, const std::string& path, BundleKind kind,
                                  const BundleFactsRef& known) const {
    using State = ScannedBundle::State;
    _watch(directory, path);
    const std::string itself;
    const Place place{directory, itself, path};
    if (known && isUnchanged(place, kind, *known, Look::thorough, _watch))
        return {State::unchanged, {}, known->identity, known};

    FileStates states;
    auto facts = std::make_shared<BundleFacts>();
    facts->identity = states.addBundle(place, kind);
    const auto bytes = readFile(directory, manifestName, maximumManifestSize);
    if (!bytes && isShortage(static_cast<int>(bytes.error().code)))
        return {State::unknown, bytes.error().text(), facts->identity, nullptr};
    const auto without = [&](State state, std::string reason) {
        return ScannedBundle{state, std::move(reason), facts->identity, nullptr};
    };
    if (!bytes) return without(State::unusable, bytes.error().text());
    if (!*bytes) return without(State::absent, {});
    if ((*bytes)->empty()) return without(State::unfinished, {});
    const auto value = decodePropertyList(**bytes, maximumManifestNesting);
    if (!value) return without(State::unusable, std::string(manifestName) + ": " + value.error().text());
    const auto info = value->dictionary();
    if (!info) return without(State::unusable, std::string(manifestName) + ": not a dictionary");
    std::size_t left = maximumManifestValues + 1; // the manifest is a value itself
    if (!takeValues(left, *info)) {
        const std::string limit = std::to_string(maximumManifestValues);
        return without(State::unusable, std::string(manifestName) + ": more than " + limit + " values");
    }
    std::string content;
    appendCompact(content, *info);
    // Few ask for an application's manifest, and then for a name in it.
    facts->info = std::make_shared<const StoredDictionary>(
        content, _strings,
        kind == BundleKind::application ? StoredDictionary::Keeps::encoding : StoredDictionary::Keeps::whatWasAskedFor);

    const auto executable = info->string("VBBundleExecutable");
    if (kind == BundleKind::plugIn && executable && isFileName(*executable)) {
        facts->executable = *executable;
        states.add(Look::thorough, directory, facts->executable);
        const Descriptor program(openat(directory, facts->executable.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
        const auto entitlements = program ? readEntitlements(program.get()) : Result(std::optional<Dictionary>());
        // Entitlements that cannot be read entitle to nothing.
        if (entitlements && *entitlements) {
            content += "entitlements=";
            const std::size_t start = content.size();
            appendCompact(content, **entitlements);
            facts->entitlements = std::make_shared<const StoredDictionary>(
                std::string_view(content).substr(start), _strings, StoredDictionary::Keeps::whatWasAskedFor);
        }
    }
    facts->hasResources = visitResources(place, _watch, states, &content);
    facts->evidence = states.evidence();
    facts->fingerprint = digest(content);
    return {State::read, {}, facts->identity, facts};
}

} // namespace platform::linux_
