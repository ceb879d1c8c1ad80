#pragma once

#include "platform/Transport.h"

#include <algorithm>
#include <deque>
#include <map>
#include <set>
#include <utility>
#include <vector>

namespace support::fake_transport {

using namespace platform;
using Step = std::function<void()>;

inline void call(const std::shared_ptr<WorkQueue>& queue, Step step) { queue ? queue->async(std::move(step)) : step(); }

/// What is to happen to a listener or an end of a connection once that is resumed.
struct Delivery {
    std::weak_ptr<const void> target;
    const bool* isResumed; // the target's
    Step step;
};
using Line = std::deque<Delivery>;

class Service final : public Listener, public std::enable_shared_from_this<Service> {
public:
    Service(std::shared_ptr<Line> line, std::shared_ptr<WorkQueue> queue, bool isAllowed)
        : _line(std::move(line)), _queue(std::move(queue)), _isAllowed(isAllowed) {}

    std::optional<std::string> refusal() const override {
        return _isAllowed ? std::nullopt : std::optional<std::string>("service not allowed");
    }
    void setEventHandler(EventHandler handler) override { _handler = std::move(handler); }
    void resume() override { _isResumed = true; }
    void cancel() override {
        _handler = nullptr; // connections that wait for it end
        _isResumed = true;
    }
    void arrive(Event event) {
        _line->push_back({weak_from_this(), &_isResumed, [this, event = std::move(event)] {
                              _queue->async([handler = _handler, event] { // it may cancel this
                                  if (handler) handler(event);
                              });
                          }});
    }

private:
    const std::shared_ptr<Line> _line;
    const std::shared_ptr<WorkQueue> _queue;
    const bool _isAllowed;
    EventHandler _handler;
    bool _isResumed = false;
};

/// A request: its sender waits with it for the reply, which its receiver sends by it.
struct Request final : ReplyToken {
    std::shared_ptr<WorkQueue> queue;
    Connection::ReplyHandler handler;

    void end(ReplyOrError reply) {
        call(queue, [hear = std::move(handler), reply = std::move(reply)] { hear(reply); });
    }
};

/// One end of a connection.
class End final : public Connection {
public:
    /// Without a queue it is an accepted one.
    End(std::shared_ptr<Line> line, std::shared_ptr<WorkQueue> queue, AuditToken peer)
        : _line(std::move(line)), _queue(std::move(queue)), _peer(std::move(peer)) {}
    ~End() override { drop(); }

    std::weak_ptr<End> other;
    Step onResume; // once

    std::int32_t peerPid() const override { return _peer.pid; }
    AuditToken peerAuditToken() const override { return _peer; }
    std::string description() const override { return "<fake connection, pid " + std::to_string(_peer.pid) + ">"; }
    void setContext(std::shared_ptr<void> context, std::function<void(std::shared_ptr<void>)> finalizer) override {
        _finalize = [context = std::move(context), finalizer = std::move(finalizer)] { finalizer(context); };
    }
    void setEventHandler(EventHandler handler) override {
        if (!_isClosed) _handler = std::move(handler);
    }
    void resume() override {
        _self = shared_from_this();
        _isResumed = true;
        if (onResume) std::exchange(onResume, nullptr)();
    }
    void cancel() override { close(); }
    void send(const ReplyMessage& reply) override {
        const auto request = std::dynamic_pointer_cast<Request>(reply.token);
        if (!request || _isClosed) return;
        tellOther([request, content = *Value(reply.content).dictionary()](End& to) {
            if (std::erase(to._pending, request) > 0) request->end(content);
        });
    }
    void sendWithReply(const Dictionary& message, std::shared_ptr<WorkQueue> queue, ReplyHandler handler) override {
        const auto request = std::make_shared<Request>();
        request->queue = std::move(queue);
        request->handler = std::move(handler);
        if (_isClosed) return request->end(invalid);
        _pending.push_back(request);
        sendEvent(ReceivedMessage{message, request});
    }
    /// The other end hears `event` after all that was sent before.
    void sendEvent(const ConnectionEvent& event) {
        tellOther([event](End& to) {
            if (to._handler) call(to._queue, [handler = to._handler, event] { handler(event); });
        });
    }
    /// The end without a word to anybody here.
    void drop() {
        _handler = nullptr;
        _pending.clear();
        close();
    }

private:
    inline static const TransportError invalid{TransportErrorKind::connectionInvalid, "Connection invalid"};

    void tellOther(const std::function<void(End&)>& tell) {
        const auto to = other.lock();
        if (!to) return;
        to->arrive([tell, to = to.get()] {
            if (!to->_isClosed) tell(*to);
        });
    }
    void arrive(Step step) { _line->push_back({weak_from_this(), &_isResumed, std::move(step)}); }
    void close() {
        if (std::exchange(_isClosed, true)) return;
        tellOther([](End& to) { to.close(); });
        for (const auto& request : std::exchange(_pending, {})) request->end(invalid);
        call(_queue, [handler = std::exchange(_handler, nullptr), finalize = std::exchange(_finalize, nullptr)] {
            if (handler) handler(invalid);
            if (finalize) finalize();
        });
        _self = nullptr;
    }

    const std::shared_ptr<Line> _line;
    const std::shared_ptr<WorkQueue> _queue;
    const AuditToken _peer;
    EventHandler _handler;
    std::vector<std::shared_ptr<Request>> _pending;
    Step _finalize;
    std::shared_ptr<Connection> _self; // from when it is resumed until it is invalid
    bool _isResumed = false;
    bool _isClosed = false; // nothing is sent or delivered any more
};

struct Activity final : KeepAliveActivity {
    explicit Activity(std::shared_ptr<const void> held) : mark(std::move(held)) {}
    const std::shared_ptr<const void> mark;
};

/// A transport within the process. What is sent waits in one line, in the order sent, until it is delivered. On the
/// test's thread alone; handlers of accepted connections run in `deliver`.
class FakeTransport final : public Transport {
public:
    ~FakeTransport() override {
        for (const auto& weak : _ends) {
            if (const auto end = weak.lock()) end->drop();
        }
        for (const auto& [name, weak] : _services) {
            if (const auto service = weak.lock()) service->cancel();
        }
        _line->clear();
    }

    /// Nobody may listen for a service that was not allowed.
    void allowService(const std::string& name) { _allowed.insert(name); }
    /// Whom connections made from now on show to the other end.
    void setPeer(AuditToken peer) { _peer = std::move(peer); }
    /// As if nobody listened anywhere: connections that are resumed from now on are invalid.
    void refuseConnections() { _isRefusing = true; }

    /// Delivers all that waits, and what is sent meanwhile. Answers how much.
    std::size_t deliver() {
        const auto isDue = [](const auto& each) { return each.target.expired() || *each.isResumed; };
        for (std::size_t count = 0;; ++count) {
            const auto next = std::ranges::find_if(*_line, isDue);
            if (next == _line->end()) return count;
            const auto delivery = std::move(*next);
            _line->erase(next);
            if (const auto target = delivery.target.lock()) delivery.step();
        }
    }

    // What only a test does to an end of a connection, or to a listener. Everything waits in the line as messages do.

    /// A message with any content, without reply.
    void sendValue(const std::shared_ptr<Connection>& from, const Value& content) {
        dynamic_cast<End&>(*from).sendEvent(ReceivedMessage{content, nullptr});
    }
    /// The other end hears termination-imminent, and still replies.
    void shutDownSending(const std::shared_ptr<Connection>& from) {
        dynamic_cast<End&>(*from).sendEvent(
            TransportError{TransportErrorKind::terminationImminent, "Peer sends no more"});
    }
    /// `to` hears `event`, whatever that is.
    void inject(const std::shared_ptr<Listener>& to, Listener::Event event) {
        dynamic_cast<Service&>(*to).arrive(std::move(event));
    }

    std::size_t activityCount() const { return static_cast<std::size_t>(_activities.use_count()) - 1; }

    std::shared_ptr<Listener> createListener(const std::string& name, std::shared_ptr<WorkQueue> queue) override {
        const auto listener = std::make_shared<Service>(_line, std::move(queue), _allowed.contains(name));
        if (!listener->refusal()) _services[name] = listener;
        return listener;
    }
    std::shared_ptr<Connection> connect(const std::string& serviceName, std::shared_ptr<WorkQueue> queue) override {
        const auto client = std::make_shared<End>(_line, std::move(queue), AuditToken());
        const auto accepted = std::make_shared<End>(_line, nullptr, _peer);
        client->other = accepted;
        accepted->other = client;
        _ends.insert(_ends.end(), {client, accepted});
        // The other end goes, and this one with it, unless a listener takes it.
        client->onResume = [this, serviceName, accepted] {
            const auto service = _services[serviceName].lock();
            if (service && !_isRefusing) service->arrive(accepted);
        };
        return client;
    }
    std::unique_ptr<KeepAliveActivity> beginActivity(const std::string&) override {
        return std::make_unique<Activity>(_activities);
    }

private:
    const std::shared_ptr<Line> _line = std::make_shared<Line>();
    std::vector<std::weak_ptr<End>> _ends;
    std::set<std::string> _allowed;
    std::map<std::string, std::weak_ptr<Service>> _services;
    AuditToken _peer;
    bool _isRefusing = false;
    const std::shared_ptr<const void> _activities = std::make_shared<int>(); // held by each
};

} // namespace support::fake_transport

namespace support {
using fake_transport::FakeTransport;
}
