#include "tests/support/TransportFake.h"

#include <atomic>
#include <deque>
#include <functional>
#include <map>
#include <optional>
#include <variant>
#include <vector>

namespace support {

using namespace platform;

/// What all ends of one transport share. Its mutex guards them too, and is held by no one who calls a handler.
struct FakeExchange {
    using Step = std::function<void()>;

    std::recursive_mutex mutex; // ends are destroyed, and tell each other so, under it
    FakeTransport::Mode mode = FakeTransport::Mode::manual;
    std::atomic<bool> isStopped = false;
    bool isDelivering = false;
    bool refuses = false;
    std::deque<Step> line;
    std::set<std::string> allowed;
    std::map<std::string, std::weak_ptr<FakeListener>> listeners;
    std::set<std::shared_ptr<FakeConnection>> keptConnections; // resumed and not invalid yet
    std::set<std::shared_ptr<FakeListener>> keptListeners;
    AuditToken peer;
    std::shared_ptr<std::atomic<std::size_t>> activities = std::make_shared<std::atomic<std::size_t>>(0);

    void add(Step step) {
        const std::lock_guard lock(mutex);
        if (!isStopped) line.push_back(std::move(step));
    }
    /// To be called without the lock, after steps were added.
    void settle() {
        if (mode == FakeTransport::Mode::inPlace) deliver();
    }
    std::size_t deliver() {
        std::size_t count = 0;
        std::unique_lock lock(mutex);
        if (isDelivering) return 0;
        isDelivering = true;
        while (!line.empty()) {
            Step step = std::move(line.front());
            line.pop_front();
            lock.unlock();
            step();
            step = nullptr;
            ++count;
            lock.lock();
        }
        isDelivering = false;
        return count;
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

class FakeActivity final : public KeepAliveActivity {
public:
    explicit FakeActivity(std::shared_ptr<std::atomic<std::size_t>> count) : _count(std::move(count)) { ++*_count; }
    ~FakeActivity() override { --*_count; }

private:
    const std::shared_ptr<std::atomic<std::size_t>> _count;
};

} // namespace

class FakeToken final : public ReplyToken {
public:
    FakeToken(std::weak_ptr<FakeConnection> from, std::weak_ptr<FakeConnection> to, std::uint64_t number)
        : sender(std::move(from)), receiver(std::move(to)), id(number) {}
    const std::weak_ptr<FakeConnection> sender; // waits for the reply
    const std::weak_ptr<FakeConnection> receiver;
    const std::uint64_t id;
    std::atomic<bool> isUsed = false;
};

class FakeListener final : public Listener, public std::enable_shared_from_this<FakeListener> {
public:
    FakeListener(std::shared_ptr<FakeExchange> exchange, std::shared_ptr<WorkQueue> queue)
        : _exchange(std::move(exchange)), _queue(std::move(queue)) {}

    void setEventHandler(EventHandler handler) override {
        const std::lock_guard lock(_exchange->mutex);
        if (!_isCancelled) _handler = std::make_shared<EventHandler>(std::move(handler));
    }
    void resume() override {
        {
            const std::lock_guard lock(_exchange->mutex);
            if (_isResumed || _isCancelled) return;
            _isResumed = true;
            _exchange->keptListeners.insert(shared_from_this());
            for (Event& event : std::exchange(_waiting, {})) add(std::move(event));
        }
        _exchange->settle();
    }
    void cancel() override {
        std::shared_ptr<EventHandler> handler;
        std::vector<Event> waiting; // connections among them end when this goes
        const std::lock_guard lock(_exchange->mutex);
        _isCancelled = true;
        waiting.swap(_waiting);
        handler.swap(_handler);
        _exchange->keptListeners.erase(shared_from_this());
    }
    bool isCancelled() const { return _isCancelled; }

    /// With the lock held.
    void arrive(Event event) {
        if (_isCancelled) return;
        if (_isResumed) return add(std::move(event));
        _waiting.push_back(std::move(event));
    }

private:
    void add(Event event) {
        _exchange->add([self = shared_from_this(), event = std::move(event)] {
            self->_queue->async([self, event] {
                std::shared_ptr<EventHandler> handler;
                {
                    const std::lock_guard lock(self->_exchange->mutex);
                    if (!self->_exchange->isStopped) handler = self->_handler;
                }
                if (handler) (*handler)(event);
            });
        });
    }

    const std::shared_ptr<FakeExchange> _exchange;
    const std::shared_ptr<WorkQueue> _queue;
    std::shared_ptr<EventHandler> _handler;
    std::vector<Event> _waiting;
    bool _isResumed = false;
    bool _isCancelled = false;
};

class FakeConnection final : public Connection {
public:
    /// Without a queue it is an accepted one.
    FakeConnection(std::shared_ptr<FakeExchange> exchange, std::shared_ptr<WorkQueue> queue)
        : _exchange(std::move(exchange)), _queue(std::move(queue)) {}

    ~FakeConnection() override {
        {
            const std::lock_guard lock(_exchange->mutex);
            if (!_isClosed) endOther();
        }
        _exchange->settle();
        for (auto& [id, pending] : _pending) {
            pending.queue->async([handler = std::move(pending.handler)] { handler(invalidError); });
        }
        finalize(std::move(_context), std::move(_finalizer));
    }

    void join(const std::shared_ptr<FakeConnection>& other) { _other = other; }
    void setService(std::string name) { _service = std::move(name); }
    void setToken(AuditToken token) { _token = std::move(token); }
    std::shared_ptr<FakeConnection> other() const { return _other.lock(); }

    std::int32_t peerPid() const override { return peerAuditToken().pid; }
    AuditToken peerAuditToken() const override {
        const std::lock_guard lock(_exchange->mutex);
        return _token;
    }
    void setContext(std::shared_ptr<void> context, std::function<void(std::shared_ptr<void>)> finalizer) override {
        const std::lock_guard lock(_exchange->mutex);
        _context.swap(context);
        _finalizer.swap(finalizer);
    }
    void setEventHandler(EventHandler handler) override {
        const std::lock_guard lock(_exchange->mutex);
        if (!_isClosed) _handler = std::make_shared<EventHandler>(std::move(handler));
    }
    std::string description() const override { return "<fake connection, pid " + std::to_string(peerPid()) + ">"; }

    void resume() override {
        {
            const std::lock_guard lock(_exchange->mutex);
            if (_isResumed) return;
            _isResumed = true;
            _exchange->keptConnections.insert(self());
            if (_service) lookUp();
            for (auto& step : std::exchange(_unsent, {})) step();
            for (Arrival& arrival : std::exchange(_waiting, {})) arrive(std::move(arrival));
        }
        _exchange->settle();
    }

    void cancel() override {
        {
            const std::lock_guard lock(_exchange->mutex);
            if (_isCancelled) return;
            _isCancelled = true;
            endOther();
            end();
        }
        _exchange->settle();
    }

    void send(const ReplyMessage& reply) override {
        const auto token = std::dynamic_pointer_cast<FakeToken>(reply.token);
        if (!token || token->receiver.lock().get() != this || token->isUsed.exchange(true)) return;
        {
            const std::lock_guard lock(_exchange->mutex);
            const auto sender = token->sender.lock();
            if (!sender || _isClosed || _isCancelled) return;
            sender->arrive(Answer{token->id, copied(reply.content)});
        }
        _exchange->settle();
    }

    void sendWithReply(const Dictionary& message, std::shared_ptr<WorkQueue> queue, ReplyHandler handler) override {
        sendValue(message, std::move(queue), std::move(handler));
    }

    void sendValue(const Value& content, std::shared_ptr<WorkQueue> queue, ReplyHandler handler) {
        {
            const std::lock_guard lock(_exchange->mutex);
            if (_isClosed || _isCancelled) {
                if (handler) queue->async([handler = std::move(handler)] { handler(invalidError); });
                return;
            }
            const std::uint64_t id = _nextId++;
            const bool expectsReply = handler != nullptr;
            if (expectsReply) _pending.emplace(id, Pending{std::move(queue), std::move(handler)});
            std::function<void()> step = [this, id, expectsReply, content = copied(content)] {
                transmit(id, expectsReply, content);
            };
            if (_isResumed || !_service) {
                step();
            } else {
                _unsent.push_back(std::move(step));
            }
        }
        _exchange->settle();
    }

    void shutDownSending() {
        {
            const std::lock_guard lock(_exchange->mutex);
            if (const auto receiver = other()) {
                receiver->hear(TransportError{TransportErrorKind::terminationImminent, "Peer sends no more"});
            }
        }
        _exchange->settle();
    }

    /// With the lock held: `event` comes after all that was sent before.
    void hear(ConnectionEvent event) { arrive(std::move(event)); }
    /// With the lock held: this end becomes invalid after all that was sent before.
    void end() {
        if (_isEnding) return;
        _isEnding = true;
        arrive(End{});
    }
    void endOther() {
        if (const auto receiver = other()) receiver->end();
    }

    void drop() {
        std::shared_ptr<EventHandler> handler;
        std::map<std::uint64_t, Pending> pending;
        std::shared_ptr<void> context;
        std::function<void(std::shared_ptr<void>)> finalizer;
        {
            const std::lock_guard lock(_exchange->mutex);
            _isClosed = true;
            handler.swap(_handler);
            pending.swap(_pending);
            context.swap(_context);
            finalizer.swap(_finalizer);
        }
        finalize(std::move(context), std::move(finalizer));
    }

private:
    struct Answer {
        std::uint64_t id;
        Value content;
    };
    struct End {};
    using Arrival = std::variant<ConnectionEvent, Answer, End>;
    struct Pending {
        std::shared_ptr<WorkQueue> queue;
        ReplyHandler handler;
    };

    std::shared_ptr<FakeConnection> self() { return std::static_pointer_cast<FakeConnection>(shared_from_this()); }

    static void finalize(std::shared_ptr<void> context, std::function<void(std::shared_ptr<void>)> finalizer) {
        if (finalizer) finalizer(std::move(context));
    }

    // With the lock held.
    void arrive(Arrival arrival) {
        if (!_isResumed) return _waiting.push_back(std::move(arrival));
        _exchange->add([receiver = self(), arrival = std::move(arrival)] { receiver->take(arrival); });
    }
    void lookUp() {
        const auto found = _exchange->listeners.find(*_service);
        const auto listener = found == _exchange->listeners.end() ? nullptr : found->second.lock();
        if (!listener || listener->isCancelled() || _exchange->refuses) return end();
        auto accepted = std::make_shared<FakeConnection>(_exchange, nullptr);
        accepted->setToken(_exchange->peer);
        accepted->join(self());
        join(accepted);
        listener->arrive(std::shared_ptr<Connection>(accepted));
    }
    void transmit(std::uint64_t id, bool expectsReply, const Value& content) {
        const auto receiver = other();
        if (!receiver) return end();
        auto token = expectsReply ? std::make_shared<FakeToken>(weak(), receiver->weak(), id) : nullptr;
        receiver->hear(ReceivedMessage{content, std::move(token)});
    }
    std::weak_ptr<FakeConnection> weak() { return self(); }

    void take(const Arrival& arrival) {
        if (const auto* event = std::get_if<ConnectionEvent>(&arrival)) {
            callHandler(*event);
        } else if (const auto* reply = std::get_if<Answer>(&arrival)) {
            answer(reply->id, reply->content);
        } else {
            becomeInvalid();
        }
    }

    void callHandler(const ConnectionEvent& event) {
        std::shared_ptr<EventHandler> handler;
        {
            const std::lock_guard lock(_exchange->mutex);
            if (_isClosed || _isCancelled) return;
            handler = _handler;
        }
        if (!handler) return;
        if (!_queue) return (*handler)(event);
        _queue->async([exchange = _exchange, handler, event] {
            if (!exchange->isStopped) (*handler)(event);
        });
    }

    void answer(std::uint64_t id, const Value& content) {
        std::optional<Pending> pending;
        {
            const std::lock_guard lock(_exchange->mutex);
            const auto found = _pending.find(id);
            if (found == _pending.end() || _isCancelled) return;
            pending = std::move(found->second);
            _pending.erase(found);
        }
        pending->queue->async([exchange = _exchange, handler = std::move(pending->handler), content] {
            if (!exchange->isStopped) handler(*content.dictionary());
        });
    }

    void becomeInvalid() {
        std::shared_ptr<EventHandler> handler;
        std::map<std::uint64_t, Pending> pending;
        {
            const std::lock_guard lock(_exchange->mutex);
            if (_isClosed) return;
            _isClosed = true;
            endOther();
            handler.swap(_handler);
            pending.swap(_pending);
            _exchange->keptConnections.erase(self());
        }
        for (auto& [id, waiting] : pending) {
            waiting.queue->async([exchange = _exchange, reply = std::move(waiting.handler)] {
                if (!exchange->isStopped) reply(invalidError);
            });
        }
        auto last = [connection = self(), handler = std::move(handler)]() mutable {
            if (handler && !connection->_exchange->isStopped) (*handler)(invalidError);
            handler.reset();
            connection->drop();
        };
        if (_queue) {
            _queue->async(std::move(last));
        } else {
            last();
        }
    }

    const std::shared_ptr<FakeExchange> _exchange;
    const std::shared_ptr<WorkQueue> _queue;
    // Guarded by the exchange's mutex.
    std::optional<std::string> _service; // still to be looked up when resumed
    std::weak_ptr<FakeConnection> _other;
    AuditToken _token;
    bool _isResumed = false;
    bool _isCancelled = false;
    bool _isEnding = false;
    bool _isClosed = false;
    std::uint64_t _nextId = 1;
    std::map<std::uint64_t, Pending> _pending;
    std::vector<std::function<void()>> _unsent;
    std::vector<Arrival> _waiting;
    std::shared_ptr<EventHandler> _handler;
    std::shared_ptr<void> _context;
    std::function<void(std::shared_ptr<void>)> _finalizer;
};

namespace {

std::shared_ptr<FakeConnection> fake(const std::shared_ptr<Connection>& connection) {
    return std::dynamic_pointer_cast<FakeConnection>(connection);
}

} // namespace

FakeTransport::FakeTransport(Mode mode) : _exchange(std::make_shared<FakeExchange>()) { _exchange->mode = mode; }

FakeTransport::~FakeTransport() {
    std::deque<FakeExchange::Step> line;
    std::set<std::shared_ptr<FakeConnection>> connections;
    std::set<std::shared_ptr<FakeListener>> listeners;
    {
        const std::lock_guard lock(_exchange->mutex);
        _exchange->isStopped = true;
        line.swap(_exchange->line);
        connections.swap(_exchange->keptConnections);
        listeners.swap(_exchange->keptListeners);
    }
    for (const auto& connection : connections) connection->drop();
    for (const auto& listener : listeners) listener->cancel();
}

void FakeTransport::allowService(const std::string& name) {
    const std::lock_guard lock(_exchange->mutex);
    _exchange->allowed.insert(name);
}

void FakeTransport::setPeer(AuditToken peer) {
    const std::lock_guard lock(_exchange->mutex);
    _exchange->peer = std::move(peer);
}

void FakeTransport::refuseConnections(bool refuse) {
    const std::lock_guard lock(_exchange->mutex);
    _exchange->refuses = refuse;
}

std::size_t FakeTransport::deliver() { return _exchange->deliver(); }

std::pair<std::shared_ptr<Connection>, std::shared_ptr<Connection>>
FakeTransport::makePair(AuditToken peer, std::shared_ptr<WorkQueue> queue) {
    auto client = std::make_shared<FakeConnection>(_exchange, std::move(queue));
    auto accepted = std::make_shared<FakeConnection>(_exchange, nullptr);
    accepted->setToken(std::move(peer));
    client->join(accepted);
    accepted->join(client);
    return {client, accepted};
}

void FakeTransport::sendValue(const std::shared_ptr<Connection>& from, const Value& content,
                              std::shared_ptr<WorkQueue> queue, Connection::ReplyHandler handler) {
    fake(from)->sendValue(content, std::move(queue), std::move(handler));
}

void FakeTransport::shutDownSending(const std::shared_ptr<Connection>& from) { fake(from)->shutDownSending(); }

void FakeTransport::inject(const std::shared_ptr<Connection>& to, ConnectionEvent event) {
    {
        const std::lock_guard lock(_exchange->mutex);
        const auto* error = std::get_if<TransportError>(&event);
        if (error && error->kind == TransportErrorKind::connectionInvalid) {
            fake(to)->end();
        } else {
            fake(to)->hear(std::move(event));
        }
    }
    _exchange->settle();
}

void FakeTransport::inject(const std::shared_ptr<Listener>& to, Listener::Event event) {
    {
        const std::lock_guard lock(_exchange->mutex);
        std::dynamic_pointer_cast<FakeListener>(to)->arrive(std::move(event));
    }
    _exchange->settle();
}

std::size_t FakeTransport::activityCount() const { return *_exchange->activities; }

std::shared_ptr<Listener> FakeTransport::createListener(const std::string& serviceName,
                                                        std::shared_ptr<WorkQueue> queue) {
    const std::lock_guard lock(_exchange->mutex);
    auto listener = std::make_shared<FakeListener>(_exchange, std::move(queue));
    auto& place = _exchange->listeners[serviceName];
    const auto owner = place.lock();
    if (owner && !owner->isCancelled()) {
        listener->arrive(TransportError{TransportErrorKind::other, "service name taken: " + serviceName});
    } else if (!_exchange->allowed.contains(serviceName)) {
        listener->arrive(TransportError{TransportErrorKind::other, "service not allowed: " + serviceName});
    } else {
        place = listener;
    }
    return listener;
}

std::shared_ptr<Connection> FakeTransport::connect(const std::string& serviceName, std::shared_ptr<WorkQueue> queue) {
    auto connection = std::make_shared<FakeConnection>(_exchange, std::move(queue));
    connection->setService(serviceName);
    return connection;
}

std::unique_ptr<KeepAliveActivity> FakeTransport::beginActivity(const std::string&) {
    return std::make_unique<FakeActivity>(_exchange->activities);
}

} // namespace support
