#pragma once

#include "platform/Platform.h"
#include "zbd/RecentVerdicts.h"
#include "zbd/ZBDPlugInHold.h"
#include "zbd/ZBDUserPrefs.h"
#include "zbd/ZBDatabase.h"

#include <functional>
#include <list>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

namespace zbd {

class ZBDQmxClient;

/// The one server object: it listens on the named service, runs every request on its service queue, and keeps the
/// holds. It is at the same time the plug-in database and its delegate.
class ZBDServer final : public ZBDatabase, public ZBDatabaseDelegate {
public:
    using Holds = std::list<std::shared_ptr<ZBDPlugInHold>>;

    /// A server whose listener is suspended until `run`. Null, with the reason logged, when the service's name cannot
    /// be had. Main thread. The platform must outlive the process's other threads.
    static std::shared_ptr<ZBDServer> initForService(platform::Platform& platform, const std::string& serviceName,
                                                     const std::optional<std::string>& annotationDatabasePath);

    /// The last constructed server.
    static std::shared_ptr<ZBDServer> server();

    /// Resumes the listener and serves the main run loop. Main thread; does not return while the process lives.
    void run();

    /// Enqueues `item` on the service queue: it runs later, after everything submitted before it. Any thread. What
    /// `isBrief`, asked when its turn comes, says to be done in microseconds is spared a hand-over that costs as much.
    void submitWork(platform::WorkQueue::Item item, std::function<bool()> isBrief = nullptr);

    /// Accepts no further connections and releases every hold. Existing connections are not touched. Not on the holds
    /// queue.
    void stop();

    // ZBDatabaseDelegate: ends the running instances of plug-ins that were uninstalled.
    void removedPlugIns(const std::vector<platform::PlugInProxyRef>& proxies) override;

    // ZBDServerHolds.cpp. Not to be called on the holds queue.

    /// The holds in force, in the order they were added.
    Holds holds() const;
    bool hasHolds() const;
    bool holdOnPlugIn(const ZBDPlugInRef& plugIn);
    void addHold(const std::shared_ptr<ZBDPlugInHold>& hold);
    void unholdToken(const platform::UUID& token);
    void unholdClient(const std::shared_ptr<ZBDQmxClient>& client);
    /// Asks the service manager to end the running instances of each plug-in. `reply` runs once, on a queue of its own,
    /// after it has answered for all of them; no thread waits meanwhile.
    void terminatePlugIns(const std::vector<platform::PlugInProxyRef>& proxies, std::function<void()> reply);

    std::uint32_t verbose() const { return _verbose; }
    void setVerbose(std::uint32_t verbose) { _verbose = verbose; }
    const std::shared_ptr<platform::WorkQueue>& qmxQueue() const { return _qmxQueue; }
    const std::shared_ptr<platform::WorkQueue>& mainQueue() const { return _mainQueue; }
    const std::shared_ptr<platform::WorkQueue>& syncQueue() const { return _syncQueue; }
    const std::shared_ptr<platform::Listener>& service() const { return _service; }
    const ZBDUserPrefs& userPrefs() const { return *_userPrefs; }
    RecentVerdicts& recentVerdicts() { return _recentVerdicts; }

private:
    explicit ZBDServer(platform::Platform& platform);
    void handleListenerEvent(const platform::Listener::Event& event);
    void removeHold(const platform::UUID& token);
    void releaseAllHolds();

    // Set during construction and only read afterwards.
    std::uint32_t _verbose = 0;
    std::shared_ptr<platform::WorkQueue> _qmxQueue;
    std::shared_ptr<platform::WorkQueue> _mainQueue;
    std::shared_ptr<platform::Listener> _service;
    std::unique_ptr<ZBDUserPrefs> _userPrefs;
    std::shared_ptr<platform::WorkQueue> _syncQueue;

    RecentVerdicts _recentVerdicts; // on the service queue only

    // On _syncQueue only.
    struct Place {
        Holds::iterator amongAll;
        Holds::iterator amongItsClients;
    };
    Holds _holds;                                                                   // in the order they were added
    std::map<std::weak_ptr<ZBDQmxClient>, Holds, std::owner_less<>> _holdsByClient; // in that order too, none empty
    std::unordered_map<platform::UUID, Place> _holdsByToken;
    std::unordered_map<ZBDPlugInRef, std::size_t, zembra::ZBPlugInHash, zembra::ZBPlugInEqual> _holdCounts;
};

} // namespace zbd
