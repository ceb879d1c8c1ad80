#pragma once

#include "Zembra/ZBBundle.h"
#include "platform/CodeSigning.h"
#include "platform/Transport.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

namespace zbd {

class ZBDServer;

/// One connected host: who it is, and what it asks. Kept alive by its connection, which it holds only weakly.
class ZBDQmxClient final : public std::enable_shared_from_this<ZBDQmxClient> {
public:
    /// Finds out who the peer is and starts receiving at once. Called on the listener queue.
    static std::shared_ptr<ZBDQmxClient> initWithConnection(const std::shared_ptr<platform::Connection>& connection,
                                                            const std::shared_ptr<ZBDServer>& server);

    /// Asked of the transport on each call; -1 when the connection is gone.
    std::int32_t pid() const;

    /// The host's value for the entitlement, or an absent one. A failure of the code-signing service is logged.
    platform::Value entitlementValueForKey(std::string_view name) const;
    /// True for any value but the boolean false and the number 0.
    bool hasEntitlement(std::string_view name) const;

    /// The host's end is about to go away; its requests are still served.
    void dying();
    /// The connection is invalid: the holds end, and requests that still wait are dropped.
    void dead();

    std::string description() const;

    bool acceptWork() const { return _acceptWork.load(std::memory_order_relaxed); }
    std::uint32_t requestCount() const { return _requestCount; }
    std::shared_ptr<platform::Connection> connection() const { return _connection.lock(); }
    const std::shared_ptr<ZBDServer>& server() const { return _server; }
    /// The peer as it connected; good also when the connection is gone.
    const platform::AuditToken& auditToken() const { return _auditToken; }
    /// The executable's path; empty when it could not be learnt.
    const std::string& path() const { return _path; }
    /// None when the executable's path could not be learnt.
    const std::shared_ptr<zembra::ZBBundle>& bundle() const { return _bundle; }

private:
    ZBDQmxClient(const std::shared_ptr<platform::Connection>& connection, std::shared_ptr<ZBDServer> server);
    void handleEvent(const platform::ConnectionEvent& event);
    void handleRequest(const platform::ReceivedMessage& message);

    std::atomic<bool> _acceptWork{true}; // written on the delivery thread, read on the service queue
    std::uint32_t _requestCount = 0;     // on the service queue only
    std::weak_ptr<platform::Connection> _connection;
    std::shared_ptr<ZBDServer> _server;
    platform::AuditToken _auditToken;
    std::string _path;
    std::shared_ptr<zembra::ZBBundle> _bundle;
    std::shared_ptr<platform::SecTask> _task;
};

} // namespace zbd
