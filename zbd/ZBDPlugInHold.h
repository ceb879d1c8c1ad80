#pragma once

#include "platform/Transport.h"
#include "zbd/ZBDatabase.h"

#include <chrono>
#include <memory>
#include <vector>

namespace zbd {

class ZBDQmxClient;

/// Blocks a set of plug-ins for as long as it stands in the server's list, and keeps the daemon alive meanwhile.
/// Immutable.
class ZBDPlugInHold {
public:
    /// `client` is held weakly: a hold never keeps a connection alive.
    static std::shared_ptr<ZBDPlugInHold> initWithPlugIns(platform::Transport& transport,
                                                          const std::vector<ZBDPlugInRef>& plugIns,
                                                          const std::shared_ptr<ZBDQmxClient>& client);

    const platform::UUID& uuid() const { return _uuid; }
    const ZBDPlugInSet& blocked() const { return _blocked; }
    std::shared_ptr<ZBDQmxClient> client() const { return _client.lock(); }
    /// Tells clients apart also when they are gone.
    const std::weak_ptr<ZBDQmxClient>& clientReference() const { return _client; }
    std::chrono::system_clock::time_point created() const { return _created; }

    friend bool operator==(const ZBDPlugInHold& left, const ZBDPlugInHold& right) { return left._uuid == right._uuid; }

private:
    ZBDPlugInHold() = default;

    platform::UUID _uuid = platform::UUID::random();
    ZBDPlugInSet _blocked;
    std::weak_ptr<ZBDQmxClient> _client;
    std::chrono::system_clock::time_point _created = std::chrono::system_clock::now();
    std::unique_ptr<platform::KeepAliveActivity> _activity;
};

} // namespace zbd

template <> struct std::hash<zbd::ZBDPlugInHold> {
    std::size_t operator()(const zbd::ZBDPlugInHold& hold) const noexcept {
        return std::hash<platform::UUID>()(hold.uuid());
    }
};
