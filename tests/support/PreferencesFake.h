#pragma once

#include "platform/Preferences.h"

#include <map>

namespace support {

/// Preferences in memory. A domain is refused until it is added, and what is stored shows after `synchronize`.
class FakePreferences final : public platform::Preferences {
public:
    /// As another process would; an absent value removes.
    void store(const std::string& domain, const std::string& key, platform::Value value) {
        _stored[domain][key] = std::move(value);
    }

    void addDomain(const std::string& domain) override { _read.try_emplace(domain); }
    bool synchronize(const std::string& domain) override {
        if (!_read.contains(domain)) return false;
        _read[domain] = _stored[domain];
        return true;
    }
    platform::Value value(const std::string& domain, const std::string& key) override {
        return _read.contains(domain) ? _read[domain][key] : platform::Value();
    }

private:
    using Domains = std::map<std::string, std::map<std::string, platform::Value>>;
    Domains _stored;
    Domains _read;
};

} // namespace support
