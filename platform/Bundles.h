#pragma once

#include "platform/PropertyList.h"

#include <memory>
#include <optional>
#include <string>

namespace platform {

enum class BundleProperty { path, executablePath, supportPath };

/// One bundle directory. Its path stays; the manifest is read anew on each call.
class BundleObject {
public:
    virtual ~BundleObject() = default;
    virtual std::optional<std::string> property(BundleProperty property) const = 0;
    /// None when there is no manifest, or it is no dictionary or nests beyond `maximumManifestNesting`.
    virtual std::optional<Dictionary> infoDictionary() const = 0;
    virtual std::string description() const = 0;
};

enum class BundleMode { directory, executable };

/// The bundle facility. Bundles are flat directories: `Info.vlist` at the top, the executable named by its
/// "VBBundleExecutable" beside it, `PlugIns/` and `Resources/<language>/` below.
class Bundles {
public:
    virtual ~Bundles() = default;
    virtual std::shared_ptr<const BundleObject> main() = 0;
    /// In executable mode the object has no path property unless `path` is the executable of the bundle around it.
    virtual std::shared_ptr<const BundleObject> fromPath(const std::string& path, BundleMode mode) = 0;
};

} // namespace platform
