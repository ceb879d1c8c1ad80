#include "platform/linux/TransportConnection.h"

#include "platform/linux/ActingAsPeer.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/ProcPath.h"
#include "platform/linux/TransportLimits.h"
#include "platform/linux/TransportMessage.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <system_error>

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77 // newer than the C library's headers
#endif

namespace platform::linux_::qmx {

namespace {

constexpr const char* invalidText = "Connection invalid";
constexpr const char* budgetText = "too many bytes of this user wait";

TransportError invalid(const std::string& reason) {
    return {TransportErrorKind::connectionInvalid,
            reason.empty() ? std::string(invalidText) : std::string(invalidText) + ": " + reason};
}

std::string systemText(int number) { return std::generic_category().message(number); }

/// Retried because a full backlog gives a non-blocking connect nothing to wait for.
constexpr std::chrono::milliseconds connectRetryDelay{5};

} // namespace

int withSocketAddress(const std::string& directory, const std::string& name,
                      const std::function<int(const sockaddr*, socklen_t)>& use) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::string path = directory + "/" + name;
    Descriptor opened;
    if (path.size() >= sizeof address.sun_path) {
        opened = Descriptor(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        if (!opened) return -1;
        path = procPath(opened.get()) + "/" + name;
    }
    if (path.size() >= sizeof address.sun_path) {
        errno = ENAMETOOLONG;
        return -1;
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    // Through void*: a socket address is passed as its general form by definition of the interface.
    const void* const general = &address;
    return use(static_cast<const sockaddr*>(general), sizeof address);
}

namespace {

std::optional<ucred> peerCredentials(int socket) {
    ucred credentials{};
    socklen_t size = sizeof credentials;
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) return std::nullopt;
    return credentials;
}

} // namespace

std::optional<std::uint32_t> peerUser(int socket) {
    const auto credentials = peerCredentials(socket);
    if (!credentials) return std::nullopt;
    return credentials->uid;
}

std::optional<AuditToken> identifyPeer(int socket) {
    const auto credentials = peerCredentials(socket);
    auto rights = rightsOfPeer(socket);
    // A process outside this pid namespace has no pid here.
    if (!credentials || credentials->pid <= 0 || !rights) return std::nullopt;
    int pidfd = -1;
    socklen_t size = sizeof pidfd;
    // An older kernel lacks the option; then the pid is opened, which is as good: the handshake proves that the
    // process that has the pid now is the one at the other end.
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &size) != 0 && errno != ENOPROTOOPT) return std::nullopt;
    auto process = LinuxPeerProcess::look(credentials->pid, Descriptor(pidfd), std::move(rights->groups));
    if (!process) return std::nullopt;
    return AuditToken{credentials->pid, credentials->uid, credentials->gid, std::move(process)};
}

/// Frees the message's place among the waiting ones when it goes without having been answered.
class StreamConnection::Token final : public ReplyToken {
public:
    Token(std::weak_ptr<StreamConnection> connection, WaitingMessage message, Budget::Share share)
        : _connection(std::move(connection)), _message(message), _share(std::move(share)) {}
    ~Token() override {
        if (_used) return;
        if (const auto connection = _connection.lock()) connection->forget(_message);
    }
    Token(const Token&) = delete;
    Token& operator=(const Token&) = delete;

    const WaitingMessage& message() const { return _message; }
    bool belongsTo(const StreamConnection& connection) const {
        return !_connection.owner_before(connection.weak_from_this()) &&
               !connection.weak_from_this().owner_before(_connection);
    }
    /// True once. Gives the share back: the next request may come before the last holder of this one lets go.
    bool use() {
        if (_used.exchange(true)) return false;
        _share = {};
        return true;
    }

private:
    const std::weak_ptr<StreamConnection> _connection;
    const WaitingMessage _message;
    Budget::Share _share; // kept without the connection, whose end does not free the memory
    std::atomic<bool> _used = false;
};

StreamConnection::StreamConnection(std::shared_ptr<Loop> loop, Descriptor socket, AuditToken peer, Budget::Share place,
                                   const Budgets& budgets)
    : _loop(std::move(loop)),
      _inShare(budgets.received->shareOf(peer.uid)),
      _socket(std::move(socket)),
      _place(std::move(place)),
      _peer(std::move(peer)),
      _outShare(budgets.unsent->shareOf(_peer.uid)) {}

StreamConnection::StreamConnection(std::shared_ptr<Loop> loop, std::string directory, std::string serviceName,
                                   std::shared_ptr<WorkQueue> queue)
    : _loop(std::move(loop)),
      _directory(std::move(directory)),
      _serviceName(std::move(serviceName)),
      _queue(std::move(queue)) {}

StreamConnection::~StreamConnection() {
    // Only a connection that was never resumed still has something here.
    Remains remains = takeRemains();
    for (auto& [id, pending] : remains.pending) {
        pending.queue->async([handler = std::move(pending.handler)] { handler(invalid("")); });
    }
    remains.finalize();
}

std::int32_t StreamConnection::peerPid() const {
    const std::lock_guard lock(_mutex);
    return _peer.pid;
}

AuditToken StreamConnection::peerAuditToken() const {
    const std::lock_guard lock(_mutex);
    return _peer;
}

std::string StreamConnection::description() const {
    const std::lock_guard lock(_mutex);
    std::string text = isAccepted() ? "<qmx connection from pid " : "<qmx connection to " + _serviceName + " pid ";
    text += std::to_string(_peer.pid);
    if (_state == State::closed) text += ", invalid";
    return text + ">";
}

void StreamConnection::Remains::finalize() {
    handler.reset();
    if (finalizer) std::exchange(finalizer, nullptr)(std::move(context));
    context.reset();
}

StreamConnection::Remains StreamConnection::takeRemains() {
    return {std::exchange(_handler, nullptr), std::exchange(_pending, {}), std::exchange(_context, nullptr),
            std::exchange(_finalizer, nullptr)};
}

void StreamConnection::setContext(std::shared_ptr<void> context, std::function<void(std::shared_ptr<void>)> finalizer) {
    Remains old;
    const std::lock_guard lock(_mutex);
    old.context = std::exchange(_context, std::move(context)); // destroyed after the lock is given back
    old.finalizer = std::exchange(_finalizer, std::move(finalizer));
}

void StreamConnection::setEventHandler(EventHandler handler) {
    auto shared = handler ? std::make_shared<EventHandler>(std::move(handler)) : nullptr;
    const std::lock_guard lock(_mutex);
    // A closed connection would keep the handler, and what that keeps, for nothing.
    if (_state != State::closed) _handler.swap(shared);
}

void StreamConnection::resume() {
    {
        const std::lock_guard lock(_mutex);
        if (_resumed) return;
        _resumed = true;
    }
    _loop->post([connection = self()] { connection->start(); });
}

void StreamConnection::cancel() {
    {
        const std::lock_guard lock(_mutex);
        if (_cancelled || _state == State::closed) return;
        _cancelled = true;
        _ending = true;
        if (_socket) ::shutdown(_socket.get(), SHUT_RDWR); // the peer hears of it even when nobody ever resumes this
        if (!_resumed) return;
    }
    _loop->post([connection = self()] { connection->fail(""); });
}

// Sending

void StreamConnection::send(const ReplyMessage& reply) {
    auto* const token = dynamic_cast<Token*>(reply.token.get());
    if (token == nullptr || !token->belongsTo(*this) || !token->use()) return;
    const std::lock_guard lock(_mutex);
    if (_state != State::open || _cancelled) return;
    removeWaiting(token->message());
    if (!_sendBroken && !appendOut(FrameType::reply, token->message().id, reply.content)) {
        // The peer waits for an answer that can never come; an end is an answer too.
        _loop->post([connection = self()] { connection->fail("reply too long"); });
        return;
    }
    if (!_gathering || unsent() >= gatheredBytes || !_loop->isCurrent()) flushOut();
    updatePause();
    updateInterest();
}

void StreamConnection::sendWithReply(const Dictionary& message, std::shared_ptr<WorkQueue> queue,
                                     ReplyHandler handler) {
    std::optional<TransportError> error;
    {
        const std::lock_guard lock(_mutex);
        const std::uint64_t id = _nextId++;
        if (_state == State::closed || _cancelled) {
            error = invalid("");
        } else if (!appendOut(FrameType::request, id, message)) {
            error = TransportError{TransportErrorKind::other, "Message too long"};
        } else {
            _pending.emplace(id, PendingReply{queue, std::move(handler)});
            if (_state == State::open) flushOut();
            updateInterest();
        }
    }
    // Not on the caller's thread: it may hold locks that the handler takes.
    // NOLINTNEXTLINE(bugprone-use-after-move): it was moved only where there is no error
    if (error) queue->async([hear = std::move(handler), problem = std::move(*error)] { hear(problem); });
}

void StreamConnection::forget(const WaitingMessage& message) {
    const std::lock_guard lock(_mutex);
    removeWaiting(message);
    updatePause();
    updateInterest();
}

/// Does nothing for a message of a connection that is gone.
void StreamConnection::removeWaiting(const WaitingMessage& message) {
    const auto found = std::find(_waiting.begin(), _waiting.end(), message);
    if (found == _waiting.end()) return;
    _waitingBytes -= message.size;
    _waiting.erase(found);
}

bool StreamConnection::appendOut(FrameType type, std::uint64_t id, const Value& content) {
    // Only now: a long reply that nothing follows is not moved while it goes out piece by piece.
    if (_outSent > _out.size() / 2) {
        _out.erase(0, _outSent);
        _outSent = 0;
    }
    return appendFrame(_out, type, id, content);
}

/// Writes what the socket takes now. The rest goes out when the loop hears that there is room.
void StreamConnection::flushOut() {
    while (unsent() > 0) {
        const ssize_t count = ::send(_socket.get(), _out.data() + _outSent, unsent(), MSG_NOSIGNAL | MSG_DONTWAIT);
        if (count >= 0) {
            _outSent += static_cast<std::size_t>(count);
            continue;
        }
        if (errno == EINTR) continue;
        if (errno == EAGAIN) break;
        // The peer is gone or reads no more. What it sent before is still to be delivered.
        _sendBroken = true;
        _outSent = _out.size();
        _loop->post([connection = self()] { connection->drain(); });
    }
    if (unsent() == 0) {
        _out.clear();
        _outSent = 0;
        if (_out.capacity() > keptBufferBytes) _out.shrink_to_fit();
        _outShare.resize(0);
        return;
    }
    if (unsent() > maximumUnsentBytes || !_outShare.resize(_out.size())) {
        _sendBroken = true;
        _loop->post(
            [connection = self()] { connection->fail("too many bytes waiting for a peer that does not read"); });
    }
}

void StreamConnection::closeSocket() {
    _state = State::closed;
    _ending = true;
    _watched = false;
    _socket.reset();
    _place = {};
    _out = {};
    _outSent = 0;
    _outShare = {};
    _waiting.clear();
    _waitingBytes = 0;
}

/// Only an accepted connection pauses. If both ends stopped reading while the other does not read, neither would ever
/// go on.
void StreamConnection::updatePause() {
    if (!isAccepted() || _state != State::open) return;
    if (!_paused) {
        _paused = _waiting.size() >= maximumWaitingRequests || _waitingBytes > pauseWaitingBytes ||
                  unsent() > pauseUnsentBytes;
    } else if (_waiting.size() <= resumeWaitingRequests && _waitingBytes <= resumeWaitingBytes &&
               unsent() <= resumeUnsentBytes) {
        _paused = false;
        _loop->post([connection = self()] { connection->onTurn(); }); // buffered frames give no event
    }
}

void StreamConnection::updateInterest() {
    const std::uint32_t interest =
        (_reading && !_paused ? std::uint32_t{EPOLLIN} : 0U) |
        (unsent() > 0 && _state == State::open && !_gathering ? std::uint32_t{EPOLLOUT} : 0U);
    if (!_watched || interest == _interest) return;
    _interest = interest;
    _loop->rewatch(_socket.get(), interest, this);
}

// On the loop's thread

void StreamConnection::start() {
    _loop->keep(self());
    bool cancelled = false;
    {
        const std::lock_guard lock(_mutex);
        cancelled = _cancelled;
    }
    if (cancelled) return fail("");
    if (!isAccepted()) return connectSocket();
    const std::lock_guard lock(_mutex);
    _state = State::open;
    _interest = EPOLLIN;
    _watched = _loop->watch(_socket.get(), _interest, this);
    if (!_watched) _loop->post([connection = self()] { connection->fail("no room to wait for it"); });
}

void StreamConnection::connectSocket() {
    Descriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    const int outcome =
        !socket ? -1 : withSocketAddress(_directory, _serviceName, [&](const sockaddr* address, socklen_t size) {
            return ::connect(socket.get(), address, size);
        });
    if (outcome != 0 && errno == EAGAIN) {
        _loop->after(connectRetryDelay, [connection = self()] {
            bool closed = false;
            {
                const std::lock_guard lock(connection->_mutex);
                closed = connection->_state == State::closed;
            }
            if (!closed) connection->connectSocket();
        });
        return;
    }
    if (outcome != 0) return fail("no service " + _serviceName + " (" + systemText(errno) + ")");
    bool watched = false;
    {
        const std::lock_guard lock(_mutex);
        if (const auto token = identifyPeer(socket.get())) _peer = *token;
        _socket = std::move(socket);
        _state = State::greeting;
        _interest = EPOLLIN;
        watched = _watched = _loop->watch(_socket.get(), _interest, this);
    }
    if (!watched) fail("no room to wait for it");
}

void StreamConnection::onEvents(std::uint32_t events) {
    if (events & (EPOLLHUP | EPOLLERR)) {
        drain();
        return;
    }
    if (events & EPOLLOUT) {
        const std::lock_guard lock(_mutex);
        if (_state == State::open) flushOut();
        updatePause();
        updateInterest();
    }
    if (events & EPOLLIN) read();
}

/// From here on nothing goes to the peer. The socket is no longer waited for, because an end that nobody takes note of
/// would wake the thread for ever; turns take its place.
void StreamConnection::drain() {
    {
        const std::lock_guard lock(_mutex);
        if (_state == State::closed) return;
        if (_watched) _loop->unwatch(_socket.get());
        _watched = false;
        _sendBroken = true;
        _out = {};
        _outSent = 0;
        _outShare.resize(0);
        updatePause();
    }
    _draining = true;
    _loop->again(this);
}

void StreamConnection::onTurn() { read(); }

void StreamConnection::read() {
    {
        const std::lock_guard lock(_mutex);
        if (_state == State::closed || _paused || _problem) return; // unpausing gives another turn
    }
    if (_frameBuffered) {
        deliverBuffered();
    } else {
        const std::span<char> buffer = _loop->scratch();
        const ssize_t count = ::recv(_socket.get(), buffer.data(), buffer.size(), MSG_DONTWAIT);
        if (count == 0) return readEnd();
        if (count < 0) {
            if (errno == EINTR) return _loop->again(this);
            // A peer that shut down its receiving side only has nothing more for us here and is as good as gone.
            if (errno == EAGAIN) return _draining ? fail("") : void();
            return fail(systemText(errno));
        }
        const std::string_view bytes(buffer.data(), static_cast<std::size_t>(count));
        // Frames are decoded where they lie; only the start of one that is not complete yet is kept.
        const bool isDirect = _in.empty() && _state == State::open;
        if (!keep(isDirect ? bytes.substr(deliverFrames(bytes)) : bytes)) return fail(budgetText);
        if (!isDirect) {
            if (_state == State::greeting) readGreeting();
            if (_state == State::open) deliverBuffered();
        }
    }
    const std::lock_guard lock(_mutex);
    if (_state != State::closed && !_paused && (_frameBuffered || _draining)) _loop->again(this);
}

/// Keeps `bytes` for later; false when their user has too many here already.
bool StreamConnection::keep(std::string_view bytes) {
    const std::size_t needed = _in.size() + bytes.size();
    if (needed > _in.capacity()) {
        // By what came, never by what a frame announces.
        const std::size_t capacity =
            std::max(needed, std::min(2 * _in.capacity(), frameLengthSize + maximumFrameLength));
        if (!_inShare.resize(capacity)) return false;
        _in.reserve(capacity);
    }
    _in.insert(_in.end(), bytes.begin(), bytes.end());
    return true;
}

void StreamConnection::deliverBuffered() {
    const std::size_t used = deliverFrames({_in.data(), _in.size()});
    if (_in.empty()) return; // the connection ended
    _in.erase(_in.begin(), _in.begin() + static_cast<std::ptrdiff_t>(used));
    if (_in.capacity() <= keptBufferBytes || _in.size() > _in.capacity() / 2) return;
    _in.shrink_to_fit();
    _inShare.resize(_in.capacity());
}

void StreamConnection::readEnd() {
    // A peer that closed takes no replies; one that shut down its sending side alone still does.
    pollfd closed{_socket.get(), 0, 0};
    const bool isClosed = ::poll(&closed, 1, 0) > 0 && (closed.revents & (POLLHUP | POLLERR)) != 0;
    if (_draining || isClosed) return fail("");
    if (!_in.empty()) return malformed("ends within a frame");
    // Nobody is left to answer requests, so there is nothing to wait for.
    if (!isAccepted()) return fail("the service sends no more");
    if (_ended) return;
    _ended = true;
    std::shared_ptr<EventHandler> handler;
    {
        const std::lock_guard lock(_mutex);
        _reading = false;
        updateInterest();
        handler = _handler;
    }
    deliverEvent(handler, TransportError{TransportErrorKind::terminationImminent, "Peer sends no more"});
}

void StreamConnection::readGreeting() {
    if (_in.size() < handshakeSize) return;
    Handshake greeting{};
    std::copy_n(_in.begin(), handshakeSize, greeting.begin());
    _in.erase(_in.begin(), _in.begin() + handshakeSize);
    if (!isGreeting(greeting)) return malformed("foreign greeting");
    const Handshake answer = makeAnswer(greeting);
    const std::lock_guard lock(_mutex);
    _state = State::open;
    _out.insert(0, answer.data(), answer.size()); // before the requests that waited for it
    flushOut();
    updateInterest();
}

/// Delivers the frames at the front of `bytes` and returns their size.
std::size_t StreamConnection::deliverFrames(std::string_view bytes) {
    _frameBuffered = false;
    std::size_t used = 0;
    FrameScan next = scanFrame(bytes);
    for (unsigned count = 1; next.outcome == FrameScan::Outcome::complete; ++count) {
        const FrameScan current = next;
        next = scanFrame(bytes.substr(used + current.size));
        const bool moreFollow = next.outcome == FrameScan::Outcome::complete;
        if (current.frame.type == FrameType::reply) {
            deliverReply(current.frame);
        } else if (!deliverRequest(current.frame, moreFollow && count < framesPerTurn)) {
            _frameBuffered = true; // it waits for replies to earlier ones
            break;
        }
        used += current.size;
        if (_ending || _problem) return bytes.size();
        if (moreFollow && count == framesPerTurn) {
            _frameBuffered = true; // the others first
            break;
        }
    }
    if (next.outcome == FrameScan::Outcome::malformed) {
        malformed(next.problem);
        return bytes.size();
    }
    return used;
}

void StreamConnection::onServed() {
    {
        const std::lock_guard lock(_mutex);
        if (_gathering && _state == State::open) {
            _gathering = false;
            flushOut();
            updatePause();
            updateInterest();
        }
    }
    if (_problem) fail("malformed data (" + *_problem + ")");
}

/// False when the request must wait for replies to earlier ones.
bool StreamConnection::deliverRequest(const Frame& frame, bool moreFollow) {
    const WaitingMessage waiting{frame.type, frame.id, frame.body.size()};
    const bool expectsReply = frame.type == FrameType::request;
    std::shared_ptr<EventHandler> handler;
    bool isDuplicate = false;
    {
        const std::lock_guard lock(_mutex);
        updatePause();
        if (_paused) {
            updateInterest();
            return false;
        }
        isDuplicate = expectsReply && std::any_of(_waiting.begin(), _waiting.end(), [&](const WaitingMessage& each) {
                          return each.type == FrameType::request && each.id == frame.id;
                      });
        if (!isDuplicate) {
            _waiting.push_back(waiting);
            _waitingBytes += waiting.size;
        }
        if (moreFollow && !_gathering) {
            _gathering = true;
            _loop->whenServed(this);
        }
        handler = _handler;
    }
    if (isDuplicate) {
        malformed("id of a request that still waits");
        return true;
    }
    Result<DecodedMessage> result = decodeMessage(frame.body, maximumDecodedBytes);
    if (!result) {
        malformed(result.error().text().c_str());
        return true;
    }
    DecodedMessage decoded = *std::move(result);
    Budget::Share share = _inShare.sibling();
    if (!share.resize(decoded.size)) {
        fail(budgetText);
        return true;
    }
    auto token = std::make_shared<Token>(self(), waiting, std::move(share));
    ReceivedMessage message{std::move(decoded.content), nullptr};
    if (expectsReply) {
        message.reply = std::move(token);
    } else {
        message.place = std::move(token);
    }
    deliverEvent(handler, std::move(message));
    return true;
}

void StreamConnection::deliverReply(const Frame& frame) {
    std::optional<PendingReply> pending;
    {
        const std::lock_guard lock(_mutex);
        const auto found = _pending.find(frame.id);
        if (found != _pending.end()) {
            pending = std::move(found->second);
            _pending.erase(found);
        }
    }
    if (!pending) return malformed("reply to no request");
    Result<Value> content = decodeCompact(frame.body, UUIDs::allowed);
    ReplyOrError reply = TransportError{TransportErrorKind::other, "Reply is no dictionary"};
    if (!content) {
        reply = invalid("malformed reply");
    } else if (auto dictionary = content->dictionary()) {
        reply = *std::move(dictionary);
    }
    pending->queue->async([loop = _loop, handler = std::move(pending->handler), reply = std::move(reply)] {
        if (!loop->isStopped()) handler(reply);
    });
    if (!content) malformed(content.error().text().c_str());
}

void StreamConnection::deliverEvent(const std::shared_ptr<EventHandler>& handler, ConnectionEvent event) {
    if (!handler) return;
    if (isAccepted()) return (*handler)(event);
    _queue->async([loop = _loop, handler, event = std::move(event)] {
        if (!loop->isStopped()) (*handler)(event);
    });
}

/// Nothing more is read. The end comes after the replies to what came before, as far as this thread gives them.
void StreamConnection::malformed(const char* problem) {
    if (_problem) return;
    _problem = problem;
    _loop->whenServed(this);
}

void StreamConnection::fail(const std::string& reason) {
    Remains remains;
    {
        const std::lock_guard lock(_mutex);
        if (_state == State::closed) return;
        if (_watched) _loop->unwatch(_socket.get());
        closeSocket();
        remains = takeRemains();
    }
    _in = {};
    _inShare = {};
    _frameBuffered = false;
    const TransportError error = invalid(reason);
    for (auto& [id, pending] : remains.pending) {
        pending.queue->async([loop = _loop, handler = std::move(pending.handler), error] {
            if (!loop->isStopped()) handler(error);
        });
    }
    remains.pending.clear();
    if (isAccepted()) {
        if (remains.handler) (*remains.handler)(error);
        remains.finalize();
    } else {
        _queue->async([loop = _loop, remains = std::move(remains), error]() mutable {
            if (remains.handler && !loop->isStopped()) (*remains.handler)(error);
            remains.finalize();
        });
    }
    _loop->drop(this);
}

void StreamConnection::shutDown() {
    Remains remains;
    {
        const std::lock_guard lock(_mutex);
        closeSocket();
        remains = takeRemains();
    }
    remains.pending.clear();
    remains.finalize();
}

} // namespace platform::linux_::qmx
