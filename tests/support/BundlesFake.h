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
    struct Content {
        platform::Dictionary manifest;
        std::optional<std::string> executablePath;
        bool hasReadableManifest = true;
        bool hasSupportPath = true;
    };

    /// Adds or replaces. Objects given out before see the new manifest.
    Content& add(const std::string& path, platform::Dictionary manifest,
                 std::optional<std::string> executablePath = std::nullopt) {
        auto& content = _bundles[path];
        if (!content) content = std::make_shared<Content>();
        *content = Content{std::move(manifest), std::move(executablePath)};
        return *content;
    }

    /// The running program.
    std::string mainExecutable = "/usr/bin/program";

    BundleRef main() override {
        auto bundle = fromPath(mainExecutable, Mode::executable);
        return bundle->property(Property::path) ? bundle : fromPath(mainExecutable, Mode::directory);
    }
    BundleRef fromPath(const std::string& path, Mode mode) override {
        if (mode == Mode::directory) {
            const std::string trimmed = path.ends_with('/') ? path.substr(0, path.size() - 1) : path;
            return std::make_shared<Object>(trimmed, _bundles.contains(trimmed) ? _bundles[trimmed] : nullptr);
        }
        for (const auto& [directory, content] : _bundles)
            if (content->executablePath == path) return std::make_shared<Object>(directory, content);
        return std::make_shared<Object>(std::nullopt, nullptr);
    }

private:
    class Object final : public platform::BundleObject {
    public:
        Object(std::optional<std::string> path, std::shared_ptr<const Content> content)
            : _path(std::move(path)), _content(std::move(content)) {}

        std::optional<std::string> property(Property property) const override {
            if (property == Property::path) return _path;
            if (!_content) return std::nullopt;
            if (property == Property::executablePath) return _content->executablePath;
            return _content->hasSupportPath ? _path : std::nullopt;
        }
        std::optional<platform::Dictionary> infoDictionary() const override {
            return _content && _content->hasReadableManifest ? std::optional(_content->manifest) : std::nullopt;
        }
        std::string description() const override { return "<bundle " + _path.value_or("none") + ">"; }

    private:
        const std::optional<std::string> _path;
        const std::shared_ptr<const Content> _content;
    };

    std::map<std::string, std::shared_ptr<Content>> _bundles;
};

} // namespace support
