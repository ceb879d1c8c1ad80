#pragma once

#include "platform/Platform.h"
#include "platform/PropertyList.h"
#include "platform/Url.h"

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace zbd {

class ZBDPlugIn;

/// What is to become of one plug-in's annotation: see `setAnnotation`.
struct AnnotationChange {
    std::optional<platform::Dictionary> annotation;
    std::shared_ptr<const ZBDPlugIn> plugIn;
};

/// Keeps the user's annotations of plug-ins in one small property-list file that survives restarts.
/// Takes no lock: the database calls it on its own queue, or while no change can happen.
class ZBDAnnotationStore {
public:
    /// The one format that is read and written; older files start afresh.
    static constexpr int databaseVersion = 16;
    /// Neither read nor written beyond this: hosts choose what they store, and a file that cannot be read back would
    /// lose everything.
    static constexpr std::size_t maximumFileSize = std::size_t{64} << 20U;

    /// A store with its table loaded, migrated or empty. `path` is taken as written; none means the default location.
    /// Never writes unless it migrates. A container service that fails ends the process.
    static std::unique_ptr<ZBDAnnotationStore> initWithDatabase(platform::Platform& platform,
                                                                const std::optional<std::string>& path);

    std::optional<platform::Dictionary> annotationForIdentifier(std::string_view annotationKey) const;
    std::optional<platform::Dictionary> annotationForPlugIn(const ZBDPlugIn& plugIn) const;

    /// Merges `annotation` into what is stored for the plug-in, or removes that when it is none; then saves. A failure
    /// to save is logged; the change stays in memory and goes out with the next one. What no file can hold (an
    /// annotation or key with a UUID, control characters, nesting without end) is logged and not taken, for no change
    /// could be saved after it.
    void setAnnotation(const std::optional<platform::Dictionary>& annotation, const ZBDPlugIn& plugIn);
    /// The same for many, in their order, saved together. When the file would become larger than `maximumFileSize`,
    /// that is logged and none is taken. (Trying them one by one would encode a full table for each.)
    void setAnnotations(std::span<const AnnotationChange> changes);

    /// False, with `error` set, when no table could be loaded; the present table then is as it was.
    bool loadDb(const platform::URL& url, platform::Error& error);
    /// Replaces the file. One that could not be loaded holds what the user once chose, so it is kept beside the new one
    /// with the suffix ".damaged"; while it cannot be, nothing is saved.
    bool saveDb(platform::Error& error);

    /// Another one after each change. Any thread.
    std::uint64_t version() const { return _version.load(std::memory_order_relaxed); }

    const platform::URL& annotationsURL() const { return _annotationsURL; }
    const platform::MutableDictionary& annotations() const { return _annotations; }

    static platform::URL defaultDatabaseURL(platform::Platform& platform);
    static platform::URL globalURL(platform::Platform& platform);
    static platform::URL containerURL(platform::Platform& platform);

private:
    platform::Failure apply(const AnnotationChange& change);
    bool write(const std::string& bytes, platform::Error& error);
    ZBDAnnotationStore(platform::Platform& platform, platform::URL url);

    platform::Platform& _platform;
    platform::URL _annotationsURL;
    platform::MutableDictionary _annotations; // annotation key to annotation
    std::atomic<std::uint64_t> _version = 1;
    bool _isFileDamaged = false; // as long as the file that could not be loaded is in its place
};

} // namespace zbd
