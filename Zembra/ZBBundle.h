#pragma once

#include "Zembra/AtomicField.h"
#include "platform/Bundles.h"
#include "platform/Url.h"

#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace zembra {

/// Read access to a bundle on disk, as the transport's bundle facility describes it. Callable from any thread.
class ZBBundle {
public:
    /// The bundle of the running program.
    static std::shared_ptr<ZBBundle> initForMainBundle(platform::Bundles& bundles);
    static std::shared_ptr<ZBBundle> initWithURL(platform::Bundles& bundles, const platform::URL& url);
    static std::shared_ptr<ZBBundle> initWithPath(platform::Bundles& bundles, const std::string& path);
    static std::shared_ptr<ZBBundle> initWithExecutableURL(platform::Bundles& bundles, const platform::URL& url);
    /// The bundle whose executable is at `path`; for any other path the bundle directory at that path.
    static std::shared_ptr<ZBBundle> initWithExecutablePath(platform::Bundles& bundles, const std::string& path);
    static std::shared_ptr<ZBBundle> initWithQMXBundle(std::shared_ptr<const platform::BundleObject> bundle);

    std::optional<std::string> stringProperty(platform::BundleProperty property) const;
    /// Read anew on each call; a bundle without one is logged.
    std::optional<platform::Dictionary> infoDictionary() const;
    std::optional<std::string> bundleIdentifier() const;

    std::optional<platform::URL> url() const;
    std::optional<std::string> path() const;
    /// Where the bundle keeps its "PlugIns" and the like. Asked for until there is one, and kept from then on.
    std::optional<std::string> supportPath() const;
    /// `name` below the support directory, without a separator at the end.
    std::optional<std::string> bundleDirectory(std::string_view name) const;
    /// The path itself for a bundle without an executable.
    std::optional<std::string> executablePath() const;
    std::optional<std::string> plugInsPath() const;
    /// For messages; empty for no bundle.
    std::string description() const;

private:
    explicit ZBBundle(std::shared_ptr<const platform::BundleObject> bundle);

    mutable AtomicField<std::optional<std::string>> _supportPath;
    AtomicField<std::shared_ptr<const platform::BundleObject>> _bundle;
};

} // namespace zembra
