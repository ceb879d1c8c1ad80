#pragma once

#include "platform/Transport.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/TransportBudget.h"
#include "platform/linux/TransportFrame.h"
#include "platform/linux/TransportLoop.h"

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <sys/socket.h>
#include <utility>
#include <vector>

namespace platform::linux_::qmx {

struct Budgets;

/// One end of a connection over a stream socket.
///
/// Reading belongs to the loop's thread alone; what sending needs is under `_mutex`, which is never held while a
/// handler or a queue is called.
class StreamConnection final : public platform::Connection, public Pollable {
public:
    /// An accepted connection whose handshake is done, and its place among its user's connections.
    StreamConnection(std::shared_ptr<Loop> loop, Descriptor socket, AuditToken peer, Budget::Share place,
                     const Budgets& budgets);
    /// A connection to be made to the socket `serviceName` in `directory` when it is resumed.
    StreamConnection(std::shared_ptr<Loop> loop, std::string directory, std::string serviceName,
                     std::shared_ptr<WorkQueue> queue);
    ~StreamConnection() override;

    std::int32_t peerPid() const override;
    AuditToken peerAuditToken() const override;
    void setContext(std::shared_ptr<void> context, std::function<void(std::shared_ptr<void>)> finalizer) override;
    void setEventHandler(EventHandler handler) override;
    void resume() override;
    void cancel() override;
    void send(const ReplyMessage& reply) override;
    void sendWithReply(const Dictionary& message, std::shared_ptr<WorkQueue> queue, ReplyHandler handler) override;
    std::string description() const override;

    void onEvents(std::uint32_t events) override;
    void onTurn() override;
    void onServed() override;
    void shutDown() override;

private:
    class Token;
    struct PendingReply {
        std::shared_ptr<WorkQueue> queue;
        ReplyHandler handler;
    };
    /// A delivered request that waits for its reply, or a message without reply that somebody still holds.
    struct WaitingMessage {
        FrameType type;
        std::uint64_t id;
        std::size_t size; // of its frame's body
        friend bool operator==(const WaitingMessage&, const WaitingMessage&) = default;
    };
    /// What a connection that ended leaves to be told; called and dropped without the lock.
    struct Remains {
        std::shared_ptr<EventHandler> handler;
        std::map<std::uint64_t, PendingReply> pending;
        std::shared_ptr<void> context;
        std::function<void(std::shared_ptr<void>)> finalizer;

        void finalize();
    };
    enum class State { suspended, greeting, open, closed };

    bool isAccepted() const { return _queue == nullptr; }
    std::shared_ptr<StreamConnection> self() { return std::static_pointer_cast<StreamConnection>(shared_from_this()); }

    // On the loop's thread.
    void start();
    void connectSocket();
    void read();
    void readEnd();
    void readGreeting();
    bool keep(std::string_view bytes);
    void deliverBuffered();
    std::size_t deliverFrames(std::string_view bytes);
    bool deliverRequest(const Frame& frame, bool moreFollow);
    void deliverReply(const Frame& frame);
    void deliverEvent(const std::shared_ptr<EventHandler>& handler, ConnectionEvent event);
    void malformed(const char* problem);
    void drain();
    void fail(const std::string& reason);

    // With _mutex held.
    bool appendOut(FrameType type, std::uint64_t id, const Value& content);
    void flushOut();
    void closeSocket();
    void updatePause();
    void updateInterest();
    void removeWaiting(const WaitingMessage& message);
    std::size_t unsent() const { return _out.size() - _outSent; }
    Remains takeRemains();

    void forget(const WaitingMessage& message);

    const std::shared_ptr<Loop> _loop;
    const std::string _directory; // connecting ends only, as the next two
    const std::string _serviceName;
    const std::shared_ptr<WorkQueue> _queue; // null: an accepted connection

    // The loop's thread only.
    std::vector<char> _in;               // what came and was not delivered yet; its front is the start of a frame
    Budget::Share _inShare;              // the capacity of `_in`
    std::optional<std::string> _problem; // what is wrong with the data; nothing more is read then
    bool _frameBuffered = false;         // `_in` may hold a complete frame
    bool _ended = false;                 // the peer sends no more
    bool _draining = false; // the peer is gone: what it sent before is delivered, then the connection is invalid

    std::atomic<bool> _ending = false; // cancelled or closed: nothing more is delivered

    mutable std::mutex _mutex;
    // Guarded by _mutex.
    State _state = State::suspended;
    Descriptor _socket;
    Budget::Share _place; // among its user's connections
    AuditToken _peer;
    bool _resumed = false;
    bool _cancelled = false;
    bool _watched = false;
    bool _reading = true;    // false once the peer has ended
    bool _paused = false;    // requests are left unread until replies went out
    bool _gathering = false; // requests came together: replies of this thread wait for one common write
    bool _sendBroken = false;
    std::uint32_t _interest = 0;
    std::string _out;
    std::size_t _outSent = 0;
    Budget::Share _outShare;              // the size of `_out` as it was when the socket took no more
    std::vector<WaitingMessage> _waiting; // a handful
    std::size_t _waitingBytes = 0;
    std::uint64_t _nextId = 1;
    std::map<std::uint64_t, PendingReply> _pending;
    std::shared_ptr<EventHandler> _handler;
    std::shared_ptr<void> _context;
    std::function<void(std::shared_ptr<void>)> _finalizer;
};

/// Calls `use` with an address of the socket `name` in `directory`, however long that path is. The address is good
/// during the call. Returns what `use` returns, or -1 with errno when the directory cannot be opened.
int withSocketAddress(const std::string& directory, const std::string& name,
                      const std::function<int(const sockaddr*, socklen_t)>& use);

/// The identity of the process at the other end as the kernel fixed it when the connection was made.
/// None when the process is gone or cannot be seen from here.
std::optional<AuditToken> identifyPeer(int socket);
/// The user alone.
std::optional<std::uint32_t> peerUser(int socket);

} // namespace platform::linux_::qmx
