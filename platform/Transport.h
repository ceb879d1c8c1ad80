#pragma once

#include "platform/PropertyList.h"
#include "platform/WorkQueue.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <variant>

/// The IPC transport "qmx": named services, peer connections, dictionary messages and their replies.
namespace platform {

/// What the system knows of the process at the other end, fixed when the connection is accepted.
class PeerProcess {
public:
    virtual ~PeerProcess() = default;
};

/// Names one peer process for good: a pid that is used again never fits an older token.
struct AuditToken {
    std::int32_t pid = -1;
    std::uint32_t uid = 0;
    std::uint32_t gid = 0;
    std::shared_ptr<const PeerProcess> process; // the platform's own handle on the process; may be absent in tests
};

enum class TransportErrorKind { connectionInvalid, terminationImminent, other };

struct TransportError {
    TransportErrorKind kind;
    std::string description;
};

/// Routes a reply to its request. One per received request that expects a reply; opaque.
class ReplyToken {
public:
    virtual ~ReplyToken() = default;
};

/// Bytes of the longest message that travels, as `compactSize` counts it. A full "match" answer of 10,000 plug-ins is
/// about 24 MB.
inline constexpr std::size_t maximumMessageSize = (std::size_t{64} << 20U) - 64;

/// One message as it came: usually a dictionary, but a peer may send any value.
struct ReceivedMessage {
    Value content;
    std::shared_ptr<ReplyToken> reply; // absent when the sender expects no reply
    // Keeps the message's place among those that its sender has waiting here; the last copy gives it up.
    std::shared_ptr<const void> place = nullptr;
};

/// The one reply to a request, to be filled and sent.
struct ReplyMessage {
    MutableDictionary content;
    std::shared_ptr<ReplyToken> token;
    std::shared_ptr<const void> place = nullptr; // the request's
};

/// The create-reply operation: an empty reply that goes to whoever waits for this request.
inline ReplyMessage createReply(const ReceivedMessage& request) {
    return {MutableDictionary(), request.reply, request.place};
}

using ConnectionEvent = std::variant<ReceivedMessage, TransportError>;
/// A reply, or the error in its place.
using ReplyOrError = std::variant<Dictionary, TransportError>;

/// One end of a connection. All operations may be called from any thread. The transport keeps a resumed connection
/// alive until it is invalid; afterwards it drops the event handler and runs the finalizer.
class Connection : public std::enable_shared_from_this<Connection> {
public:
    using EventHandler = std::function<void(const ConnectionEvent&)>;
    using ReplyHandler = std::function<void(const ReplyOrError&)>;

    virtual ~Connection() = default;

    virtual std::int32_t peerPid() const = 0;
    virtual AuditToken peerAuditToken() const = 0;

    /// Keeps `context` until the connection is released, then calls `finalizer` with it once and drops both.
    virtual void setContext(std::shared_ptr<void> context, std::function<void(std::shared_ptr<void>)> finalizer) = 0;

    /// Called for one event at a time, in the order of arrival. An accepted connection calls it on the transport's own
    /// thread; a connection made with `connect` on its queue. A connection-invalid event comes once and is the last;
    /// termination-imminent comes when the peer shut down its sending side, and replies still reach it.
    virtual void setEventHandler(EventHandler handler) = 0;

    /// Nothing is delivered before. What came meanwhile is delivered then.
    virtual void resume() = 0;

    /// Closes. The handler hears connection-invalid; pending reply handlers get an error.
    virtual void cancel() = 0;

    /// Sends a reply made by `createReply`, once; a second reply to the same request, or one to a gone connection,
    /// goes nowhere. Never blocks: what the peer does not read yet is kept, up to a bound past which the connection
    /// is closed. The reply must not be touched afterwards.
    virtual void send(const ReplyMessage& reply) = 0;

    /// Sends `message` and calls `handler` exactly once, on `queue`, with the reply or an error in its place.
    virtual void sendWithReply(const Dictionary& message, std::shared_ptr<WorkQueue> queue, ReplyHandler handler) = 0;

    /// For logs.
    virtual std::string description() const = 0;
};

/// The listening end of a named service. Suspended until resumed; connections that come before are delivered after.
class Listener {
public:
    using Event = std::variant<std::shared_ptr<Connection>, TransportError, Value>;
    using EventHandler = std::function<void(const Event&)>;

    virtual ~Listener() = default;
    /// Why the name could not be had; none when it is ours. Before `resume`.
    virtual std::optional<std::string> refusal() const = 0;
    /// Called on the queue given at creation. A new connection starts suspended; one that nobody keeps or resumes is
    /// closed.
    virtual void setEventHandler(EventHandler handler) = 0;
    virtual void resume() = 0;
    /// No further connections are accepted, and the name is given up. Accepted connections are not touched.
    virtual void cancel() = 0;
};

/// While one exists the process is not to be stopped for idleness.
class KeepAliveActivity {
public:
    virtual ~KeepAliveActivity() = default;
};

class Transport {
public:
    virtual ~Transport() = default;
    /// A listener without its name, when that cannot be had: whoever resumes it all the same is told by an error of
    /// kind `other`.
    virtual std::shared_ptr<Listener> createListener(const std::string& serviceName,
                                                     std::shared_ptr<WorkQueue> queue) = 0;
    /// Connects when first needed; failures come as connection-invalid events and as errors in place of replies.
    virtual std::shared_ptr<Connection> connect(const std::string& serviceName, std::shared_ptr<WorkQueue> queue) = 0;
    virtual std::unique_ptr<KeepAliveActivity> beginActivity(const std::string& name) = 0;
};

} // namespace platform
