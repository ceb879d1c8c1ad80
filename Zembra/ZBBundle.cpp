#include "Zembra/ZBBundle.h"

#include "Zembra/ZBLog.h"
#include "Zembra/ZBManifest.h"
#include "Zembra/ZBUtilities.h"

#include <utility>

namespace zembra {

using platform::BundleMode;
using platform::BundleObject;
using platform::BundleProperty;
using platform::Bundles;
using platform::Dictionary;
using platform::URL;
using platform::Value;

std::shared_ptr<ZBBundle> ZBBundle::initForMainBundle(Bundles& bundles) { return initWithQMXBundle(bundles.main()); }

std::shared_ptr<ZBBundle> ZBBundle::initWithURL(Bundles& bundles, const URL& url) {
    return initWithPath(bundles, url.path());
}

std::shared_ptr<ZBBundle> ZBBundle::initWithPath(Bundles& bundles, const std::string& path) {
    return initWithQMXBundle(bundles.fromPath(path, BundleMode::directory));
}

std::shared_ptr<ZBBundle> ZBBundle::initWithExecutableURL(Bundles& bundles, const URL& url) {
    return initWithExecutablePath(bundles, url.path());
}

std::shared_ptr<ZBBundle> ZBBundle::initWithExecutablePath(Bundles& bundles, const std::string& path) {
    std::shared_ptr<ZBBundle> bundle = initWithQMXBundle(bundles.fromPath(path, BundleMode::executable));
    return bundle->path() ? bundle : initWithPath(bundles, path);
}

std::shared_ptr<ZBBundle> ZBBundle::initWithQMXBundle(std::shared_ptr<const BundleObject> bundle) {
    return std::shared_ptr<ZBBundle>(new ZBBundle(std::move(bundle)));
}

ZBBundle::ZBBundle(std::shared_ptr<const BundleObject> bundle) : _bundle(std::move(bundle)) {}

std::optional<std::string> ZBBundle::stringProperty(BundleProperty property) const {
    const auto bundle = _bundle.get();
    return bundle ? bundle->property(property) : std::nullopt;
}

std::optional<Dictionary> ZBBundle::infoDictionary() const {
    const auto bundle = _bundle.get();
    std::optional<Dictionary> info = bundle ? bundle->infoDictionary() : std::nullopt;
    if (!info) {
        const Value shownPath = valueOrAbsent(path());
        log::ops().info("failed to retrieve Info.vlist for %@ through %@", shownPath,
                        bundle ? Value(bundle->description()) : Value());
        log::ops().info("failed to convert Info.vlist to dictionary: %@ source=%@", shownPath, Value());
    }
    return info;
}

std::optional<std::string> ZBBundle::bundleIdentifier() const {
    const auto info = infoDictionary();
    const auto identifier = info ? info->string(manifest::bundleIdentifier) : std::nullopt;
    return identifier ? std::optional<std::string>(*identifier) : std::nullopt;
}

std::optional<URL> ZBBundle::url() const {
    const auto directory = path();
    return directory ? std::optional<URL>(URL::file(*directory)) : std::nullopt;
}

std::optional<std::string> ZBBundle::path() const { return stringProperty(BundleProperty::path); }

std::optional<std::string> ZBBundle::supportPath() const {
    if (auto known = _supportPath.get()) return known;
    auto fetched = stringProperty(BundleProperty::supportPath);
    if (fetched) _supportPath.set(fetched);
    return fetched;
}

std::optional<std::string> ZBBundle::bundleDirectory(std::string_view name) const {
    auto directory = supportPath();
    if (!directory) return std::nullopt;
    if (!directory->ends_with('/')) *directory += '/';
    directory->append(name);
    while (directory->size() > 1 && directory->ends_with('/')) directory->pop_back();
    return directory;
}

std::optional<std::string> ZBBundle::executablePath() const {
    auto executable = stringProperty(BundleProperty::executablePath);
    return executable ? executable : path();
}

std::optional<std::string> ZBBundle::plugInsPath() const { return bundleDirectory("PlugIns"); }

std::string ZBBundle::description() const {
    const auto bundle = _bundle.get();
    return bundle ? bundle->description() : std::string();
}

} // namespace zembra
