#pragma once

#include "platform/Error.h"
#include "platform/PropertyList.h"
#include "platform/Transport.h"
#include "platform/Url.h"
#include "platform/Uuid.h"
#include "platform/WorkQueue.h"

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zembra {

/// The requester's end of the protocol: builds each request, sends it, and reads the reply.
///
/// Operations may be called from any thread. Each calls its callback exactly once, on the client's own serial queue,
/// with the reply or the transport's error in its place; `errorInReply` tells what it means. Destroying the client ends
/// the connection; callbacks still waiting get an error then,
/// unless the transport itself ends first.
class ZBDaemonClient {
public:
    using Callback = std::function<void(const platform::ReplyOrError& reply)>;
    /// Plug-in path to plug-in UUID. The request lists them in this order.
    using PlugIns = std::map<std::string, platform::UUID>;

    /// Connects to `name`, or to the daemon's usual service when there is none. Never fails: an absent daemon shows in
    /// the replies.
    static std::shared_ptr<ZBDaemonClient> initWithServiceName(platform::Transport& transport,
                                                               platform::WorkQueues& queues,
                                                               const std::optional<std::string>& name);
    ~ZBDaemonClient();
    ZBDaemonClient(const ZBDaemonClient&) = delete;
    ZBDaemonClient& operator=(const ZBDaemonClient&) = delete;

    const std::shared_ptr<platform::WorkQueue>& replyQueue() const { return _replyQueue; }
    /// Set before the first request only.
    std::int64_t protocolVersion() const { return _protocolVersion; }
    void setProtocolVersion(std::int64_t version) { _protocolVersion = version; }

    /// The error that a reply stands for; none for success. A reply that breaks the protocol stops the process.
    static platform::Failure errorInReply(const platform::ReplyOrError& reply);

    /// The one value that holds a whole property list; none for a version that has no such encoding.
    static std::optional<platform::Value> convertToQMX(const platform::Value& value, std::uint64_t version);
    /// Back again; absent when the client's version has no such encoding or `value` does not hold one.
    platform::Value convertFromQMX(const platform::Value& value) const;

    // Building and sending, for requests that have no operation below.
    platform::MutableDictionary request(std::string_view type) const;
    platform::MutableDictionary request(std::string_view type, const std::vector<std::string>& paths) const;
    static void set(platform::MutableDictionary& message, const PlugIns& plugIns);
    static void set(platform::MutableDictionary& message, const std::vector<platform::UUID>& uuids);
    void send(const platform::Dictionary& message, Callback callback);

    void addPlugIns(const std::vector<std::string>& paths, Callback callback);
    void removePlugIns(const std::vector<std::string>& paths, Callback callback);
    void bulkPlugins(std::uint64_t flags, Callback callback);
    /// `environment` maps variable names to values.
    void readyPlugIns(const PlugIns& plugIns, std::uint64_t flags,
                      const std::optional<platform::Dictionary>& environment, Callback callback);
    void accessPlugIns(const PlugIns& plugIns, std::uint64_t flags, Callback callback);
    void findPlugInByUUID(const platform::UUID& uuid, Callback callback);
    void findPlugInByPathURL(const platform::URL& url, Callback callback);
    void matchPlugIns(const std::optional<platform::Dictionary>& rules, std::uint64_t flags, Callback callback);
    void setPluginAnnotations(const std::vector<platform::UUID>& uuids, const platform::Dictionary& annotations,
                              Callback callback);
    /// `annotations` maps UUID texts to dictionaries.
    void bulkSetPluginAnnotations(const platform::Dictionary& annotations, Callback callback);
    void holdPlugins(const std::vector<std::string>& paths, std::uint64_t flags, Callback callback);
    void releaseHold(const platform::UUID& token, Callback callback);

private:
    ZBDaemonClient(platform::Transport& transport, platform::WorkQueues& queues, const std::string& name);

    std::shared_ptr<platform::WorkQueue> _replyQueue;
    std::shared_ptr<platform::Connection> _zbd;
    std::int64_t _protocolVersion;
};

} // namespace zembra
