#pragma once

#include "platform/PrivacyConsent.h"

#include <map>

namespace support {

/// Grants in memory, by bundle identifier. Nothing is granted until it is decided, and what was told of a bundle once
/// is told again until its caches are flushed.
class FakePrivacyConsent final : public platform::PrivacyConsent {
public:
    /// While true, the service cannot tell.
    bool isUnavailable = false;
    /// The path of every bundle asked about.
    std::vector<std::string> asked;

    /// Without `granted` the record has no flag.
    void decide(const std::string& bundleIdentifier, std::string_view service, std::optional<bool> granted) {
        _decided[bundleIdentifier].push_back({std::string(service), granted});
    }

    void flushBundleCaches(const platform::BundleObject& bundle) override { _told.erase(pathOf(bundle)); }
    std::optional<std::vector<platform::ConsentRecord>>
    informationForBundle(const platform::BundleObject& bundle) override {
        asked.push_back(pathOf(bundle));
        const auto manifest = bundle.infoDictionary();
        const auto identifier = manifest ? manifest->string("VBBundleIdentifier") : std::nullopt;
        if (isUnavailable || !identifier) return std::nullopt;
        return _told.try_emplace(asked.back(), _decided[std::string(*identifier)]).first->second;
    }

private:
    static std::string pathOf(const platform::BundleObject& bundle) {
        return bundle.property(platform::BundleProperty::path).value_or("");
    }

    std::map<std::string, std::vector<platform::ConsentRecord>> _decided;
    std::map<std::string, std::vector<platform::ConsentRecord>> _told;
};

} // namespace support
