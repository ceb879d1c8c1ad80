#include "tests/support/TransportFake.h"

#include <deque>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <vector>

namespace support {

using namespace platform;

/// What all ends of one transport share.
struct FakeExchange : std::enable_shared_from_this<FakeExchange> {
    using Step = std::function<void()>;

    bool isStopped = false;
    bool refuses = false;
    std::deque<Step> line;
    std::set<std::string> allowed;
    std::map<std::string, std::weak_ptr<FakeListener>> listeners;
    std::set<std::shared_ptr<Connection>> keptConnections; // resumed and not invalid yet
    std::set<std::shared_ptr<Listener>> keptListeners;
    AuditToken peer;
    const std::shared_ptr<const void> activityMark = std::make_shared<int>(); // held by each activity

    void add(Step step) {
        if (!isStopped) line.push_back(std::move(step));
    }
    /// Calls `handler` on `queue` unless the transport is gone by then. Without a queue, now.
    template <class Handler, class Event>
    void call(const std::shared_ptr<WorkQueue>& queue, Handler handler, const Event& event) {
        if (!handler || isStopped) return;
        if (!queue) return handler(event);
        queue->async([self = shared_from_this(), handler = std::move(handler), event] {
            if (!self->isStopped) handler(event);
        });
    }
};

namespace {

Value copied(const Value& value) {
    std::string bytes;
    appendCompact(bytes, value);
    Result<Value> copy = decodeCompact(bytes, UUIDs::allowed);
    return copy ? *std::move(copy) : Value();
}

const TransportError invalidError{TransportErrorKind::connectionInvalid, "Connection invalid"};

struct FakeActivity final : KeepAliveActivity {
    explicit FakeActivity(std::shared_ptr<const void> held) : mark(std::move(held)) {}
    const std::shared_ptr<const void> mark;
};

struct FakeToken final : ReplyToken {
    FakeToken(std::weak_ptr<FakeConnection> from, std::weak_ptr<FakeConnection> to, std::uint64_t number)
        : sender(std::move(from)), receiver(std::move(to)), id(number) {}
    const std::weak_ptr<FakeConnection> sender; // waits for the reply
    const std::weak_ptr<FakeConnection> receiver;
    const std::uint64_t id;
    bool isUsed = false;
};

} // namespace

class FakeListener final : public Listener, public std::enable_shared_from_this<FakeListener> {
public:
    FakeListener(std::shared_ptr<FakeExchange> exchange, std::shared_ptr<WorkQueue> queue)
        : _exchange(std::move(exchange)), _queue(std::move(queue)) {}

    std::optional<std::string> refusal() const override { return _refusal; }
    void refuse(const std::string& reason) {
        _refusal = reason;
        arrive(TransportError{TransportErrorKind::other, reason});
    }
    void setEventHandler(EventHandler handler) override {
        if (!_isCancelled) _handler = std::move(handler);
    }
    void resume() override {
        if (_isCancelled || std::exchange(_isResumed, true)) return;
        _exchange->keptListeners.insert(shared_from_this());
        for (Event& event : std::exchange(_waiting, {})) arrive(std::move(event));
    }
    void cancel() override {
        _isCancelled = true;
        _waiting.clear(); // connections among them end
        _handler = nullptr;
        _exchange->keptListeners.erase(shared_from_this());
    }
    bool isCancelled() const { return _isCancelled; }

    void arrive(Event event) {
        if (_isCancelled) return;
        if (!_isResumed) return _waiting.push_back(std::move(event));
        _exchange->add([self = shared_from_this(), event = std::move(event)] {
            const EventHandler handle = [self](const Event& each) {
                const EventHandler handler = self->_handler; // it may cancel this
                if (handler) handler(each);
            };
            self->_exchange->call(self->_queue, handle, event);
        });
    }

private:
    const std::shared_ptr<FakeExchange> _exchange;
    const std::shared_ptr<WorkQueue> _queue;
    EventHandler _handler;
    std::vector<Event> _waiting;
    std::optional<std::string> _refusal;
    bool _isResumed = false;
    bool _isCancelled = false;
};

class FakeConnection final : public Connection {
public:
    /// Without a queue it is an accepted one. `service` is looked up when it is resumed.
    FakeConnection(std::shared_ptr<FakeExchange> exchange, std::shared_ptr<WorkQueue> queue, AuditToken token,
                   std::optional<std::string> service = std::nullopt)
        : _exchange(std::move(exchange)),
          _queue(std::move(queue)),
          _service(std::move(service)),
          _token(std::move(token)) {}
    ~FakeConnection() override {
        _remains.handler = nullptr; // it never was resumed, or has heard its end
        close();
    }
    static void join(const std::shared_ptr<FakeConnection>& one, const std::shared_ptr<FakeConnection>& other) {
        one->_other = other;
        other->_other = one;
    }
    std::shared_ptr<FakeConnection> other() const { return _other.lock(); }

    std::int32_t peerPid() const override { return _token.pid; }
    AuditToken peerAuditToken() const override { return _token; }
    std::string description() const override { return "<fake connection, pid " + std::to_string(_token.pid) + ">"; }
    void setContext(std::shared_ptr<void> context, std::function<void(std::shared_ptr<void>)> finalizer) override {
        _remains.context = std::move(context);
        _remains.finalizer = std::move(finalizer);
    }
    void setEventHandler(EventHandler handler) override {
        if (!_isClosed) _remains.handler = std::move(handler);
    }
    void resume() override {
        if (std::exchange(_isResumed, true)) return;
        _exchange->keptConnections.insert(self());
        if (_service) lookUp();
        for (auto& step : std::exchange(_unsent, {})) step();
        for (auto& step : std::exchange(_waiting, {})) arrive(std::move(step));
    }
    void cancel() override {
        if (std::exchange(_isCancelled, true)) return;
        endOther();
        end();
    }
    void send(const ReplyMessage& reply) override {
        const auto token = std::dynamic_pointer_cast<FakeToken>(reply.token);
        if (!token || token->receiver.lock().get() != this || std::exchange(token->isUsed, true)) return;
        const auto sender = token->sender.lock();
        if (!sender || _isClosed || _isCancelled) return;
        sender->arrive(
            [to = sender.get(), id = token->id, content = copied(reply.content)] { to->answer(id, content); });
    }
    void sendWithReply(const Dictionary& message, std::shared_ptr<WorkQueue> queue, ReplyHandler handler) override {
        sendValue(message, std::move(queue), std::move(handler));
    }
    void sendValue(const Value& content, std::shared_ptr<WorkQueue> queue, ReplyHandler handler) {
        if (_isClosed || _isCancelled) return _exchange->call(queue, std::move(handler), ReplyOrError(invalidError));
        const std::uint64_t id = _nextId++;
        const bool expectsReply = handler != nullptr;
        if (expectsReply) _remains.pending.emplace(id, Pending{std::move(queue), std::move(handler)});
        auto step = [this, id, expectsReply, content = copied(content)] { transmit(id, expectsReply, content); };
        if (_isResumed || !_service) return step();
        _unsent.emplace_back(std::move(step));
    }

    /// `event` comes after all that was sent before.
    void hear(ConnectionEvent event) {
        arrive([this, event = std::move(event)] {
            if (!_isClosed && !_isCancelled) _exchange->call(_queue, _remains.handler, event);
        });
    }
    /// This end becomes invalid after all that was sent before.
    void end() {
        if (!std::exchange(_isEnding, true)) arrive([this] { close(); });
    }

    /// Errors in place of replies, the last event, the finalizer.
    void close() {
        if (std::exchange(_isClosed, true)) return;
        endOther();
        Remains remains = std::exchange(_remains, {});
        for (auto& [id, pending] : remains.pending) {
            _exchange->call(pending.queue, std::move(pending.handler), ReplyOrError(invalidError));
        }
        const bool isOnQueue = _queue && remains.handler && !_exchange->isStopped;
        auto last = [exchange = _exchange, remains = std::move(remains)]() mutable {
            if (remains.handler && !exchange->isStopped) remains.handler(invalidError);
            remains.handler = nullptr;
            if (remains.finalizer) remains.finalizer(std::move(remains.context));
        };
        if (isOnQueue) {
            _queue->async(std::move(last));
        } else {
            last();
        }
        std::erase_if(_exchange->keptConnections, [this](const auto& each) { return each.get() == this; });
    }

private:
    struct Pending {
        std::shared_ptr<WorkQueue> queue;
        ReplyHandler handler;
    };
    /// What is given up when the connection becomes invalid.
    struct Remains {
        EventHandler handler;
        std::map<std::uint64_t, Pending> pending;
        std::shared_ptr<void> context;
        std::function<void(std::shared_ptr<void>)> finalizer;
    };

    std::shared_ptr<FakeConnection> self() { return std::static_pointer_cast<FakeConnection>(shared_from_this()); }

    void endOther() {
        if (const auto other = _other.lock()) other->end();
    }
    void arrive(FakeExchange::Step step) {
        if (!_isResumed) return _waiting.push_back(std::move(step));
        _exchange->add([receiver = self(), step = std::move(step)] { step(); });
    }
    void lookUp() {
        const auto found = _exchange->listeners.find(*_service);
        const auto listener = found == _exchange->listeners.end() ? nullptr : found->second.lock();
        if (!listener || listener->isCancelled() || _exchange->refuses) return end();
        auto accepted = std::make_shared<FakeConnection>(_exchange, nullptr, _exchange->peer);
        join(accepted, self());
        listener->arrive(std::shared_ptr<Connection>(accepted));
    }
    void transmit(std::uint64_t id, bool expectsReply, const Value& content) {
        const auto receiver = other();
        if (!receiver) return end();
        receiver->hear(
            ReceivedMessage{content, expectsReply ? std::make_shared<FakeToken>(self(), receiver, id) : nullptr});
    }
    void answer(std::uint64_t id, const Value& content) {
        const auto found = _isCancelled ? decltype(_remains.pending)::node_type() : _remains.pending.extract(id);
        if (found) _exchange->call(found.mapped().queue, found.mapped().handler, ReplyOrError(*content.dictionary()));
    }
    const std::shared_ptr<FakeExchange> _exchange;
    const std::shared_ptr<WorkQueue> _queue;
    const std::optional<std::string> _service;
    const AuditToken _token;
    std::weak_ptr<FakeConnection> _other;
    bool _isResumed = false;
    bool _isCancelled = false;
    bool _isEnding = false;
    bool _isClosed = false;
    std::uint64_t _nextId = 1;
    std::vector<FakeExchange::Step> _unsent;
    std::vector<FakeExchange::Step> _waiting;
    Remains _remains;
};

namespace {

std::shared_ptr<FakeConnection> fake(const std::shared_ptr<Connection>& connection) {
    return std::dynamic_pointer_cast<FakeConnection>(connection);
}

} // namespace

FakeTransport::FakeTransport() : _exchange(std::make_shared<FakeExchange>()) {}

FakeTransport::~FakeTransport() {
    _exchange->isStopped = true;
    _exchange->line.clear();
    for (const auto& connection : std::exchange(_exchange->keptConnections, {})) fake(connection)->close();
    for (const auto& listener : std::exchange(_exchange->keptListeners, {})) listener->cancel();
}

void FakeTransport::allowService(const std::string& name) { _exchange->allowed.insert(name); }
void FakeTransport::setPeer(AuditToken peer) { _exchange->peer = std::move(peer); }
void FakeTransport::refuseConnections() { _exchange->refuses = true; }

std::size_t FakeTransport::deliver() {
    std::size_t count = 0;
    for (; !_exchange->line.empty(); ++count) {
        const FakeExchange::Step step = std::move(_exchange->line.front());
        _exchange->line.pop_front();
        step();
    }
    return count;
}

std::pair<std::shared_ptr<Connection>, std::shared_ptr<Connection>>
FakeTransport::makePair(AuditToken peer, std::shared_ptr<WorkQueue> queue) {
    const auto client = std::make_shared<FakeConnection>(_exchange, std::move(queue), AuditToken());
    const auto accepted = std::make_shared<FakeConnection>(_exchange, nullptr, std::move(peer));
    FakeConnection::join(client, accepted);
    return {client, accepted};
}

void FakeTransport::sendValue(const std::shared_ptr<Connection>& from, const Value& content) {
    fake(from)->sendValue(content, nullptr, nullptr);
}

void FakeTransport::shutDownSending(const std::shared_ptr<Connection>& from) {
    const auto to = fake(from)->other();
    if (to) to->hear(TransportError{TransportErrorKind::terminationImminent, "Peer sends no more"});
}

void FakeTransport::inject(const std::shared_ptr<Listener>& to, Listener::Event event) {
    std::dynamic_pointer_cast<FakeListener>(to)->arrive(std::move(event));
}

std::size_t FakeTransport::activityCount() const {
    return static_cast<std::size_t>(_exchange->activityMark.use_count()) - 1;
}

std::shared_ptr<Listener> FakeTransport::createListener(const std::string& serviceName,
                                                        std::shared_ptr<WorkQueue> queue) {
    auto listener = std::make_shared<FakeListener>(_exchange, std::move(queue));
    auto& place = _exchange->listeners[serviceName];
    const auto owner = place.lock();
    if (owner && !owner->isCancelled()) {
        listener->refuse("service name taken: " + serviceName);
    } else if (!_exchange->allowed.contains(serviceName)) {
        listener->refuse("service not allowed: " + serviceName);
    } else {
        place = listener;
    }
    return listener;
}

std::shared_ptr<Connection> FakeTransport::connect(const std::string& serviceName, std::shared_ptr<WorkQueue> queue) {
    return std::make_shared<FakeConnection>(_exchange, std::move(queue), AuditToken(), serviceName);
}

std::unique_ptr<KeepAliveActivity> FakeTransport::beginActivity(const std::string&) {
    return std::make_unique<FakeActivity>(_exchange->activityMark);
}

} // namespace support
