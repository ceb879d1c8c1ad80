#include "platform/linux/Bundles.h"

#include <climits>
#include <mutex>
#include <sys/stat.h>
#include <utility>

namespace platform::linux_ {

namespace {

constexpr std::size_t maximumManifestSize = 1U << 20U; // a manifest is kilobytes; more is an attack on our memory
constexpr std::size_t maximumPath = PATH_MAX;
constexpr int maximumExecutableDepth =
    4; // directories between a bundle and its executable, so that a deep path is cheap

std::optional<mode_t> modeOf(const std::string& path) {
    struct stat status{};
    if (::stat(path.c_str(), &status) != 0) return std::nullopt;
    return status.st_mode;
}

std::string withoutTrailingSeparators(std::string path) {
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    return path;
}

std::optional<Dictionary> readManifest(Files& files, const std::string& directory) {
    const auto bytes = files.read(directory + "/Info.vlist", maximumManifestSize);
    if (!bytes) return std::nullopt;
    const auto manifest = decodePropertyList(*bytes, maximumManifestNesting);
    return manifest ? manifest->dictionary() : std::nullopt;
}

/// The canonical path of the executable that the manifest names. None unless it is a file inside the bundle, also after
/// symbolic links are resolved: a manifest must not be able to pass another program off as the bundle's.
std::optional<std::string> findExecutable(Files& files, const std::string& directory) {
    const auto manifest = readManifest(files, directory);
    const auto name = manifest ? manifest->string("VBBundleExecutable") : std::nullopt;
    if (!name || name->empty() || name->front() == '/') return std::nullopt;
    const auto bundle = files.realPath(directory, maximumPath);
    const auto executable = files.realPath(directory + '/' + std::string(*name), maximumPath);
    if (!bundle || !executable || !executable->starts_with(*bundle + '/')) return std::nullopt;
    const auto mode = modeOf(*executable);
    if (!mode || !S_ISREG(*mode)) return std::nullopt;
    return *executable;
}

class Bundle final : public BundleObject {
public:
    Bundle(Files& files, std::string path)
        : _files(files),
          _path(withoutTrailingSeparators(std::move(path))),
          _isDirectory(S_ISDIR(modeOf(_path).value_or(0))) {}

    std::optional<std::string> property(BundleProperty property) const override {
        if (property == BundleProperty::path) return _path;
        if (!_isDirectory) return std::nullopt;
        if (property == BundleProperty::supportPath) return _path;
        std::call_once(_executableFound, [this] { _executable = findExecutable(_files, _path); });
        return _executable;
    }

    std::optional<Dictionary> infoDictionary() const override { return readManifest(_files, _path); }
    std::string description() const override { return "<bundle " + _path + ">"; }

private:
    Files& _files;
    const std::string _path;
    const bool _isDirectory;
    // Looked for when first asked: most bundles are opened for their identifier alone.
    mutable std::once_flag _executableFound;
    mutable std::optional<std::string> _executable;
};

/// What executable mode gives for a path that is no bundle's executable.
class NoBundle final : public BundleObject {
public:
    explicit NoBundle(std::string executable) : _executable(std::move(executable)) {}
    std::optional<std::string> property(BundleProperty) const override { return std::nullopt; }
    std::optional<Dictionary> infoDictionary() const override { return std::nullopt; }
    std::string description() const override { return "<no bundle of " + _executable + ">"; }

private:
    const std::string _executable;
};

std::shared_ptr<const BundleObject> bundleOfExecutable(Files& files, const std::string& path) {
    auto none = std::make_shared<NoBundle>(path);
    const auto canonical = files.realPath(path, maximumPath);
    if (!canonical) return none;
    std::string directory = *canonical;
    for (int depth = 0; depth <= maximumExecutableDepth; ++depth) {
        directory.resize(directory.rfind('/'));
        if (directory.empty()) break;
        if (findExecutable(files, directory) == *canonical) return std::make_shared<Bundle>(files, directory);
    }
    return none;
}

} // namespace

std::shared_ptr<const BundleObject> Bundles::fromPath(const std::string& path, BundleMode mode) {
    if (mode == BundleMode::executable) return bundleOfExecutable(_files, path);
    return std::make_shared<Bundle>(_files, path);
}

std::shared_ptr<const BundleObject> Bundles::main() {
    const auto program = _files.realPath("/proc/self/exe", maximumPath);
    const std::string path = program ? *program : "/proc/self/exe"; // a deleted program has no canonical path
    auto bundle = fromPath(path, BundleMode::executable);
    return bundle->property(BundleProperty::path) ? bundle : fromPath(path, BundleMode::directory);
}

} // namespace platform::linux_
