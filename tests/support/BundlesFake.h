#pragma once

#include "platform/Bundles.h"

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>

namespace support {

/// Bundles in memory. Nothing is a bundle until it is added; any other path has its path and nothing more.
class FakeBundles final : public platform::Bundles {
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

    std::shared_ptr<const platform::BundleObject> main() override {
        auto bundle = fromPath(mainExecutable, platform::BundleMode::executable);
        if (bundle->property(platform::BundleProperty::path)) return bundle;
        return fromPath(mainExecutable, platform::BundleMode::directory);
    }

    std::shared_ptr<const platform::BundleObject> fromPath(const std::string& path,
                                                           platform::BundleMode mode) override {
        if (mode == platform::BundleMode::directory) {
            std::string trimmed = path;
            while (trimmed.size() > 1 && trimmed.back() == '/') trimmed.pop_back();
            const auto found = _bundles.find(trimmed);
            return std::make_shared<Object>(trimmed, found == _bundles.end() ? nullptr : found->second);
        }
        for (const auto& [directory, content] : _bundles) {
            if (content->executablePath == path) return std::make_shared<Object>(directory, content);
        }
        return std::make_shared<Object>(std::nullopt, nullptr);
    }

private:
    class Object final : public platform::BundleObject {
    public:
        Object(std::optional<std::string> path, std::shared_ptr<const Content> content)
            : _path(std::move(path)), _content(std::move(content)) {}

        std::optional<std::string> property(platform::BundleProperty property) const override {
            if (property == platform::BundleProperty::path) return _path;
            if (!_content) return std::nullopt;
            if (property == platform::BundleProperty::executablePath) return _content->executablePath;
            return _content->hasSupportPath ? _path : std::nullopt;
        }
        std::optional<platform::Dictionary> infoDictionary() const override {
            if (!_content || !_content->hasReadableManifest) return std::nullopt;
            return _content->manifest;
        }
        std::string description() const override { return "<bundle " + _path.value_or("none") + ">"; }

    private:
        const std::optional<std::string> _path;
        const std::shared_ptr<const Content> _content;
    };

    std::map<std::string, std::shared_ptr<Content>> _bundles;
};

} // namespace support
