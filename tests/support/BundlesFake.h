#pragma once

#include "platform/Bundles.h"

#include <map>
#include <utility>

namespace support {

/// Bundles in memory. Nothing is a bundle until it is added; any other path has its path and nothing more.
class FakeBundles final : public platform::Bundles {
    using BundleRef = std::shared_ptr<const platform::BundleObject>;
    using Property = platform::BundleProperty;
    using Mode = platform::BundleMode;

public:
    struct Bundle final : platform::BundleObject {
        Bundle(std::optional<std::string> at, bool exists) : path(std::move(at)), hasReadableManifest(exists) {}

        std::optional<std::string> property(Property property) const override {
            if (property == Property::executablePath) return executablePath;
            return property == Property::path || hasReadableManifest ? path : std::nullopt;
        }
        std::optional<platform::Dictionary> infoDictionary() const override {
            return hasReadableManifest ? std::optional(manifest) : std::nullopt;
        }
        std::string description() const override { return "<bundle " + path.value_or("none") + ">"; }

        const std::optional<std::string> path;
        platform::Dictionary manifest;
        std::optional<std::string> executablePath;
        bool hasReadableManifest;
    };

    /// Adds or replaces. Objects given out before show the new one.
    Bundle& add(const std::string& path, platform::Dictionary manifest,
                std::optional<std::string> executablePath = {}) {
        auto& bundle = *_bundles.try_emplace(path, std::make_shared<Bundle>(path, true)).first->second;
        bundle.manifest = std::move(manifest);
        bundle.executablePath = std::move(executablePath);
        return bundle;
    }

    BundleRef main() override { return fromPath("/usr/bin/program", Mode::directory); }
    BundleRef fromPath(const std::string& path, Mode mode) override {
        const std::string directory = path.ends_with('/') ? path.substr(0, path.size() - 1) : path;
        for (const auto& [place, bundle] : _bundles)
            if (mode == Mode::directory ? place == directory : bundle->executablePath == path) return bundle;
        return std::make_shared<Bundle>(mode == Mode::directory ? std::optional(directory) : std::nullopt, false);
    }

private:
    std::map<std::string, std::shared_ptr<Bundle>> _bundles;
};

} // namespace support
