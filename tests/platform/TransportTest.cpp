#include "platform/linux/Transport.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/TransportConnection.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/Mailbox.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/TransportFake.h"
#include "tests/support/WorkQueueFake.h"

#include <gmock/gmock.h>

#include <atomic>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sys/resource.h>
#include <sys/wait.h>
#include <thread>

namespace {

using namespace platform;
using namespace platform::linux_;
using namespace platform::linux_::qmx;
using support::Mailbox;

/// A service on the transport under test that collects its requests, or answers each at once.
class TransportService : public testing::Test {
protected:
    using Peer = std::shared_ptr<Connection>;

    struct Request {
        Peer connection;
        ReceivedMessage message;

        void answer(const Dictionary& content = {}) const {
            ReplyMessage reply = createReply(message);
            reply.content.merge(content);
            connection->send(reply);
        }
    };

    /// Listens and gives each new connection to `accept`.
    std::shared_ptr<Listener> listen(std::function<void(const Peer&)> accept) {
        auto made = transport->createListener(service, queues->makeSerial("qmx"));
        made->setEventHandler([this, accept = std::move(accept)](const Listener::Event& event) {
            if (const auto* error = std::get_if<TransportError>(&event)) return listenerErrors.put(*error);
            accept(std::get<Peer>(event));
        });
        return made;
    }
    /// Listens and serves all connections.
    std::shared_ptr<Listener> serve() {
        auto made = listen([this](const Peer& connection) { serve(connection); });
        made->resume();
        return made;
    }
    void serve(const Peer& connection) {
        // The handler keeps its own connection, as a client object of a server does.
        connection->setEventHandler([this, connection](const ConnectionEvent& event) {
            if (const auto* error = std::get_if<TransportError>(&event)) return errors.put(*error);
            const Request request{connection, std::get<ReceivedMessage>(event)};
            ++handled;
            answers ? request.answer(standardAnswer) : requests.put(request);
        });
        connection->resume();
    }

    /// Lets a transport without threads deliver what waits.
    virtual void settle() {}
    template <class T> T next(Mailbox<T>& mailbox) {
        settle();
        return mailbox.take().value();
    }
    Request take() { return next(requests); }
    void take(const Dictionary& expected) { EXPECT_EQ(take().message.content, Value(expected)); }
    /// A connection has ended for a reason that is described with `part`.
    void expectInvalid(const std::string& part = "") { expectInvalid(next(errors), part); }
    static void expectInvalid(const TransportError& error, const std::string& part = "") {
        EXPECT_EQ(error.kind, TransportErrorKind::connectionInvalid);
        EXPECT_THAT(error.description, testing::AllOf(testing::Not(""), testing::HasSubstr(part)));
    }

    const std::string service = "com.example.service";
    support::ScratchDirectory scratch;
    Mailbox<Request> requests;
    Mailbox<TransportError> errors; // at accepted connections
    Mailbox<TransportError> listenerErrors;
    std::atomic<std::size_t> handled = 0; // requests and messages
    std::atomic<bool> answers = false;    // each request at once, with `standardAnswer`; else they are collected
    Dictionary standardAnswer;            // set before serving
    std::unique_ptr<platform::WorkQueues> queues;
    std::unique_ptr<platform::Transport> transport; // goes first: nothing is delivered afterwards
};

/// The same cases run on sockets and on the twin.
class TransportTest : public TransportService, public testing::WithParamInterface<bool> {
protected:
    TransportTest() {
        if (GetParam()) {
            queues = std::make_unique<linux_::WorkQueues>();
            transport = std::make_unique<linux_::Transport>(linux_::Root(scratch.path()));
        } else {
            queues = std::make_unique<support::FakeWorkQueues>();
            auto fake = std::make_unique<support::FakeTransport>();
            fake->allowService(service);
            fake->setPeer({getpid(), getuid(), getgid(), nullptr});
            transport = std::move(fake);
        }
        clientQueue = queues->makeSerial("client");
    }
    ~TransportTest() override {
        settle();
        transport = nullptr; // before the mailboxes of this class
    }

    void settle() override {
        auto* const fake = dynamic_cast<support::FakeTransport*>(transport.get());
        while (fake && fake->deliver() + dynamic_cast<support::FakeWorkQueues&>(*queues).runAll() > 0) {
        }
    }

    Peer connect() {
        auto connection = transport->connect(service, clientQueue);
        connection->setEventHandler(
            [this](const ConnectionEvent& event) { clientErrors.put(std::get<TransportError>(event)); });
        connection->resume();
        return connection;
    }
    void ask(const Peer& connection, const Dictionary& message = {}) {
        connection->sendWithReply(message, clientQueue, [this](const ReplyOrError& reply) { replies.put(reply); });
    }
    void expectReply(const Dictionary& content = {}) { EXPECT_EQ(std::get<Dictionary>(next(replies)), content); }
    void expectErrorReply() { expectInvalid(std::get<TransportError>(next(replies))); }

    Mailbox<TransportError> clientErrors; // at the connecting ends
    Mailbox<ReplyOrError> replies;
    std::shared_ptr<WorkQueue> clientQueue;
};

TEST_P(TransportTest, MessagesAndRepliesArriveAsSent) {
    const auto listener = serve();
    const auto client = connect();
    const Dictionary message{{"id", UUID::random()}, {"bytes", Value::data(std::string_view("\0\xff", 2))}};
    ask(client, message);
    const Request request = take();
    EXPECT_EQ(request.message.content, Value(message));
    EXPECT_EQ(request.connection->peerPid(), getpid());
    EXPECT_EQ(request.connection->peerAuditToken().uid, getuid());
    request.answer(message);
    expectReply(message);

    // A second reply goes nowhere, and neither does one through a connection that the request did not come on.
    request.answer({{"second", true}});
    ask(connect());
    const Request next = take();
    Request{request.connection, next.message}.answer({{"astray", true}});
    next.answer({{"n", 2}});
    expectReply({{"n", 2}});
}

TEST_P(TransportTest, NothingIsDeliveredBeforeResume) {
    Mailbox<Peer> arrived;
    const auto listener = listen([&](const Peer& connection) { arrived.put(connection); });
    const auto client = connect();
    ask(client, {{"n", 1}});
    settle();
    EXPECT_EQ(arrived.size(), 0U);
    listener->resume();
    const auto connection = next(arrived);
    ask(client, {{"n", 2}});
    settle();
    EXPECT_EQ(requests.size(), 0U);
    serve(connection);
    take({{"n", 1}});
    take({{"n", 2}});
}

TEST_P(TransportTest, ConnectionsThatTheServiceEndsAreInvalid) {
    const std::function<void(const Peer&)> ways[] = {
        [](const Peer&) {}, // nobody keeps it
        [this](const Peer& connection) {
            connection->setEventHandler([this, connection](const ConnectionEvent&) {
                ++handled;
                connection->cancel();
            });
            connection->resume();
        },
        nullptr, // nobody listens
    };
    std::function<void(const Peer&)> end;
    const auto listener = listen([&end](const Peer& connection) { end(connection); });
    listener->resume();
    for (const auto& way : ways) {
        end = way;
        if (!end) listener->cancel();
        const auto client = connect();
        for (int i = 0; i < 2; ++i) ask(client);
        for (int i = 0; i < 2; ++i) expectErrorReply();
        expectInvalid(next(clientErrors));
        ask(client); // it stays invalid
        expectErrorReply();
        EXPECT_EQ(clientErrors.size(), 0U);
    }
    EXPECT_EQ(handled, 2U); // a request and the end: nothing is delivered after the cancel
}

TEST_P(TransportTest, InvalidComesLastAndReleasesEverything) {
    auto context = std::make_shared<int>(7);
    const std::weak_ptr<int> isAlive = context;
    Mailbox<int> finalized;
    const auto listener = listen([&](const Peer& connection) {
        connection->setContext(std::exchange(context, nullptr), [&](const std::shared_ptr<void>& kept) {
            finalized.put(*static_cast<int*>(kept.get()));
        });
        serve(connection);
    });
    listener->resume();
    const auto client = connect();
    std::weak_ptr<Connection> accepted;
    ask(client);
    {
        const Request request = take();
        accepted = request.connection;
        client->cancel();
        expectErrorReply();
        expectInvalid(next(clientErrors));
        expectInvalid();
        EXPECT_EQ(next(finalized), 7);
        request.answer(); // to a gone connection: goes nowhere
    }
    // The finalizer comes before the last references go, so these are waited for with a round trip.
    context = std::make_shared<int>(9);
    const auto later = connect();
    ask(later);
    const Request request = take();
    EXPECT_TRUE(isAlive.expired());
    EXPECT_TRUE(accepted.expired()); // its handler, which kept it, is gone
    EXPECT_EQ(finalized.size(), 0U);
    // The end of the transport finalizes too, but no other handler is called from then on.
    transport.reset();
    EXPECT_EQ(next(finalized), 9);
    request.answer();
    later->cancel();
    listener->cancel();
    clientQueue->sync([] {});
    EXPECT_EQ(replies.size() + errors.size() + clientErrors.size(), 0U);
}

TEST_P(TransportTest, TakenNameIsReportedAndFreeAfterCancel) {
    const auto listener = serve();
    EXPECT_EQ(listener->refusal(), std::nullopt);
    const auto client = connect();
    ask(client);
    const Request request = take();

    const auto second = listen({});
    EXPECT_TRUE(second->refusal());
    settle();
    EXPECT_EQ(listenerErrors.size(), 0U);
    second->resume();
    EXPECT_EQ(next(listenerErrors).kind, TransportErrorKind::other);
    second->cancel();

    listener->cancel();
    // Accepted connections are not touched, and their requests come after the cancel has taken effect.
    request.answer({{"n", 1}});
    expectReply({{"n", 1}});
    ask(client);
    take();
    ask(connect());
    expectErrorReply();
    const auto third = serve();
    ask(connect());
    take().answer();
    expectReply();
}

INSTANTIATE_TEST_SUITE_P(Transports, TransportTest, testing::Bool(),
                         [](const auto& each) { return each.param ? "Linux" : "Fake"; });

// What strangers may do on the sockets.

constexpr std::size_t mebibyte = std::size_t{1} << 20U;

Dictionary sized(std::size_t size) { return {{"bytes", Value::data(std::string(size, 'x'))}}; }
std::string frame(const Value& content, std::uint64_t id = 1, FrameType type = FrameType::request) {
    std::string bytes;
    appendFrame(bytes, type, id, content);
    return bytes;
}
std::string answerTo(const std::string& greeting) {
    Handshake bytes{};
    greeting.copy(bytes.data(), bytes.size());
    return {makeAnswer(bytes).data(), handshakeSize};
}

/// A stranger's end of a connection, with plain blocking calls.
struct RawPeer {
    Descriptor socket{::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};

    bool write(std::string_view bytes) {
        const ssize_t count = ::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
        return count == static_cast<ssize_t>(bytes.size());
    }
    /// Empty when the other end closes first.
    std::string read(std::size_t size) {
        std::string bytes(size, '\0');
        return ::recv(socket.get(), bytes.data(), size, MSG_WAITALL) == static_cast<ssize_t>(size) ? bytes : "";
    }
    bool isClosed() { return read(1).empty(); }
    /// Whether this is the next reply.
    bool hears(std::uint64_t id, const Dictionary& content = {}) {
        const std::string expected = frame(content, id, FrameType::reply);
        return read(expected.size()) == expected;
    }
};

class TransportPeersTest : public TransportService {
protected:
    TransportPeersTest() { ::alarm(120); } // ends a test that would hang
    ~TransportPeersTest() override { ::alarm(0); }

    void start() {
        if (!queues) queues = std::make_unique<linux_::WorkQueues>();
        transport = std::make_unique<linux_::Transport>(Root(root), limits);
        listener = serve();
    }
    std::string pathOf(const std::string& name) const { return root + "/run/nordane/" + name; }
    /// `call` is bind(2) or connect(2).
    bool callWithAddress(int (*call)(int, const sockaddr*, socklen_t), const RawPeer& peer, const std::string& name) {
        return withSocketAddress(root + "/run/nordane", name, [&](const sockaddr* address, socklen_t size) {
                   return call(peer.socket.get(), address, size);
               }) == 0;
    }
    RawPeer connected() {
        RawPeer peer;
        EXPECT_TRUE(callWithAddress(::connect, peer, service));
        return peer;
    }
    /// Connected, with the handshake done, and `bytes` sent.
    RawPeer ready(const std::string& bytes = "") {
        RawPeer peer = connected();
        peer.write(answerTo(peer.read(handshakeSize)) + bytes);
        return peer;
    }
    std::vector<Request> takeSeveral(std::size_t count) {
        std::vector<Request> taken;
        while (taken.size() < count) taken.push_back(take());
        return taken;
    }
    /// The service does its work for others, and has dealt with all that came before.
    void expectService() {
        const bool before = answers.exchange(true);
        for (int i = 0; i < 2; ++i) {
            EXPECT_TRUE(ready(frame(Dictionary())).hears(1, standardAnswer));
            expectInvalid();
        }
        answers = before;
    }

    std::string root = scratch.path();
    Limits limits;
    std::shared_ptr<Listener> listener;
};

TEST_F(TransportPeersTest, MalformedDataEndsTheConnectionAndNothingElse) {
    start();
    const std::string good = frame(Dictionary());
    const auto changed = [&](std::size_t offset, char byte) { return std::string(good).replace(offset, 1, 1, byte); };
    // Each takes one byte of the frame.
    const Array booleans(std::vector<Value>(maximumDecodedBytes / sizeof(Value), false));
    const std::pair<const char*, std::string> cases[] = {
        {"unknown frame type", changed(4, 0)},
        {"unknown frame type", changed(4, 4)},
        {"reserved bytes in use", changed(7, 1)},
        {"frame too short", changed(0, 11)},
        {"frame too long", std::string("\1\0\0\4", 4)},
        {"malformed data", changed(frameHeaderSize, 0)},
        {"too much memory", frame(booleans)},
        {"reply to no request", frame(Dictionary(), 1, FrameType::reply)},
        {"id of a request that still waits", good + good},
        {"ends within a frame", good.substr(0, good.size() - 1)},
    };
    for (const auto& [text, bytes] : cases) {
        RawPeer peer = ready(bytes);
        ::shutdown(peer.socket.get(), SHUT_WR);
        EXPECT_TRUE(peer.isClosed());
        expectInvalid(text);
    }
    EXPECT_EQ(handled, 1U); // the first of the two with one id

    answers = true;
    const std::size_t count = (maximumFrameLength - 100) / 64; // 59 of each 64 bytes are text, as in many messages
    EXPECT_TRUE(ready(frame(Array(std::vector<Value>(count, std::string(59, 't'))))).hears(1));
}

/// What a process of its own does with sockets that this one shares and sees the end of.
pid_t inChild(const std::function<void()>& work) {
    const pid_t child = fork();
    if (child == 0) {
        work();
        _exit(0);
    }
    return child;
}

TEST_F(TransportPeersTest, OnlyTheConnectedProgramAnswersTheGreeting) {
    const std::string file = scratch / "answer";
    const std::function<void(RawPeer&, std::string)> cases[] = {
        [](RawPeer& peer, const std::string& answer) {
            for (const char byte : answer + frame(Dictionary())) peer.write({&byte, 1});
        },
        [](RawPeer& peer, std::string answer) { // to another nonce
            answer.back() ^= 1;
            peer.write(answer);
        },
        [](RawPeer& peer, const std::string& answer) { // by another process, if only in part
            peer.write(answer.substr(0, 1));
            waitpid(inChild([&] { peer.write(answer.substr(1)); }), nullptr, 0);
        },
        [&](RawPeer& peer, const std::string& answer) { // by another program in the same process
            std::ofstream(file, std::ios::binary) << answer;
            ::dup2(peer.socket.get(), STDOUT_FILENO);
            ::execlp("tail", "tail", "-c", "24", "-f", file.c_str(), nullptr);
        },
    };
    RawPeer peers[std::size(cases)];
    pid_t children[std::size(cases)];
    for (std::size_t i = 0; i < std::size(cases); ++i) { // while this process has no other threads
        children[i] = inChild([&] {
            ::raise(SIGSTOP);
            callWithAddress(::connect, peers[i], service);
            const std::string answer = answerTo(peers[i].read(handshakeSize));
            ::raise(SIGSTOP);
            cases[i](peers[i], answer);
            peers[i].isClosed();
        });
    }
    start();
    for (std::size_t i = 0; i < std::size(cases); ++i) {
        for (int stop = 0; stop < 2; ++stop) { // the second: it has read the greeting, which is not for this process
            waitpid(children[i], nullptr, WUNTRACED);
            ::kill(children[i], SIGCONT);
        }
        // Closed by the service: nothing else ends it while the child is there.
        EXPECT_TRUE(i == 0 || peers[i].isClosed()) << i;
    }
    const AuditToken token = take().connection->peerAuditToken();
    const auto process = std::dynamic_pointer_cast<const LinuxPeerProcess>(token.process);
    EXPECT_EQ(std::tie(token.pid, token.uid, token.gid), std::tuple(children[0], getuid(), getgid()));
    EXPECT_TRUE(process && process->executablePath() == std::filesystem::read_symlink("/proc/self/exe"));
    for (const pid_t child : children) {
        ::kill(child, SIGKILL);
        waitpid(child, nullptr, 0);
    }
}

TEST_F(TransportPeersTest, UnfinishedHandshakesEnd) {
    limits.handshake = std::chrono::milliseconds(20);
    limits.connections.perUser = 2;
    answers = true;
    start();
    RawPeer idle;
    while (!idle.hears(1)) idle = ready(frame(Dictionary())); // on a busy machine not the first time
    // Each is there longer than the one before; each has the second place.
    for (const std::size_t size : {std::size_t{0}, handshakeSize - 1}) {
        RawPeer peer = connected();
        const std::string greeting = peer.read(handshakeSize);
        EXPECT_NE(greeting, "");
        peer.write(answerTo(greeting).substr(0, size));
        EXPECT_TRUE(peer.isClosed());
    }
    idle.write(frame(Dictionary(), 2)); // long after the deadline, which was for its handshake alone
    EXPECT_TRUE(idle.hears(2));
}

TEST_F(TransportPeersTest, ConnectionsOfOneUserAreBounded) {
    limits.connections.perUser = 2;
    start();
    RawPeer asking = ready(frame(Dictionary()));
    const Request held = take();
    RawPeer silent = connected(); // it counts like others
    EXPECT_NE(silent.read(handshakeSize), "");
    EXPECT_TRUE(connected().isClosed());
    // Whose connection is gone has no place any more, though requests that came on it are still held.
    asking.socket.reset();
    expectInvalid();
    expectService();
}

TEST_F(TransportPeersTest, WaitingMessagesAreBounded) {
    start();
    constexpr std::size_t large = 64 << 10;
    const struct {
        const char* name;
        FrameType type;
        std::size_t size;
        std::size_t bound;
        std::size_t resumed; // and fewer
    } cases[] = {
        {"requests", FrameType::request, 0, maximumWaitingRequests, resumeWaitingRequests},
        {"messages without reply", FrameType::message, 0, maximumWaitingRequests, resumeWaitingRequests},
        {"large requests", FrameType::request, large, pauseWaitingBytes / large, resumeWaitingBytes / large - 1},
    };
    for (const auto& [name, type, size, bound, resumed] : cases) {
        SCOPED_TRACE(name);
        RawPeer peer = ready();
        const std::jthread writer([&] {
            for (std::uint64_t i = 0; i < bound; ++i) peer.write(frame(sized(size), i, type));
            for (std::uint64_t i = 0; i < bound; ++i) peer.write(frame(i, bound + i, type));
        });
        std::vector<Request> taken = takeSeveral(bound);
        expectService();
        EXPECT_EQ(requests.size(), 0U);
        // Half are let go, some answered and some not: the rest comes, in order.
        for (std::size_t i = 0; i < bound / 4; ++i) taken[i].answer();
        taken.erase(taken.begin(), taken.end() - static_cast<std::ptrdiff_t>(resumed));
        for (std::uint64_t i = 0; i < bound; ++i) EXPECT_EQ(take().message.content, Value(i));
    }
}

TEST(TransportBudget, UsersShareButOrdinarySharesPass) {
    const auto budget = std::make_shared<Budget>(Budget::Limits{10, 15, 2});
    Budget::Share one = budget->shareOf(1), another = one.sibling(); // of one user
    Budget::Share two = budget->shareOf(2), three = budget->shareOf(3);
    const std::tuple<Budget::Share&, std::size_t, bool> cases[] = {
        {one, 10, true},    {another, 1, false}, // the user's own bound is for small shares too
        {two, 6, false},    {two, 5, true},
        {three, 3, false}, // all are used up
        {three, 2, true},   {three, std::numeric_limits<std::size_t>::max(), false},
        {two, 4, true}, // giving back is always possible
        {one, 0, true},     {three, 10, true},
        {another, 1, true},
    };
    for (const auto& [share, size, isGranted] : cases) EXPECT_EQ(share.resize(size), isGranted) << size;
}

TEST_F(TransportPeersTest, ReceivedBytesOfAUserAreBounded) {
    limits.received = {4 * mebibyte};
    const std::string large = frame(sized(900'000));
    start();
    std::vector<RawPeer> others; // the longest frames, only announced, are as good as nothing
    while (others.size() < 20) others.push_back(ready(std::string("\0\0\0\4", 4) + large.substr(4, 12)));
    // An answer ends the waiting, though the request is still held.
    RawPeer peer = ready();
    std::vector<Request> held;
    while (held.size() < 8) {
        peer.write(large);
        held.push_back(take());
        held.back().answer();
        EXPECT_TRUE(peer.hears(1));
    }
    // Messages count until they are dropped, also when their connection is gone.
    for (const FrameType type : {FrameType::request, FrameType::message}) {
        for (int i = 0; i < 2; ++i) {
            RawPeer asking = ready();
            for (std::uint64_t id = 0; asking.write(frame(sized(900'000), id, type)); ++id) {
            }
            expectInvalid("too many bytes of this user");
        }
        EXPECT_GE(requests.size(), 1U);
        EXPECT_LE(requests.size(), limits.received.perUser / large.size());
        takeSeveral(requests.size());
    }
    // Unfinished frames count together.
    for (int i = 0; i < 5; ++i) others.push_back(ready(large.substr(0, 900'000)));
    expectInvalid("too many bytes of this user");
}

TEST_F(TransportPeersTest, PeerThatDoesNotReadHoldsItselfUpOnly) {
    constexpr std::size_t size = 64 << 10;
    constexpr std::uint64_t count = 400;
    standardAnswer = sized(size);
    answers = true;
    start();
    RawPeer peer = ready();
    const std::jthread writer([&] {
        for (std::uint64_t id = 0; id < count; ++id) EXPECT_TRUE(peer.write(frame(sized(100), id)));
    });
    expectService();
    // What the pause allows, one more turn, and what the socket's buffer holds.
    EXPECT_LE(handled, (pauseUnsentBytes + 2 * mebibyte) / size + framesPerTurn);
    for (std::uint64_t id = 0; id < count; ++id) ASSERT_TRUE(peer.hears(id, standardAnswer)) << id;
}

TEST_F(TransportPeersTest, RepliesBeyondTheLimitsEndTheConnection) {
    start();
    RawPeer peer = ready(frame(Dictionary()));
    take().answer(sized(maximumFrameLength));
    EXPECT_TRUE(peer.isClosed());
    expectInvalid("too long");

    const Dictionary large = sized(16 * mebibyte);
    constexpr std::size_t fitting = maximumUnsentBytes / (16 * mebibyte) - 1;
    for (const bool isOneConnection : {true, false}) {
        SCOPED_TRACE(isOneConnection);
        if (!isOneConnection) limits.unsent.perUser = maximumUnsentBytes;
        start();
        std::vector<RawPeer> peers;
        for (std::uint64_t id = 0; id < fitting + 3; ++id) {
            if (id == 0 || !isOneConnection) peers.push_back(ready());
            peers.back().write(frame(Dictionary(), id));
        }
        const std::vector<Request> taken = takeSeveral(fitting + 3);
        for (std::size_t i = 0; i < fitting; ++i) taken[i].answer(large);
        expectService();
        EXPECT_EQ(errors.size(), 0U);
        for (std::size_t i = fitting; i < taken.size(); ++i) taken[i].answer(large);
        expectInvalid("does not read");
        transport = nullptr;
    }
}

TEST_F(TransportPeersTest, PeersThatEndAreHeardOutAndAnswered) {
    start();
    RawPeer half = ready(frame(Dictionary(), 1) + frame(Dictionary(), 2));
    ::shutdown(half.socket.get(), SHUT_WR);
    for (const Request& each : takeSeveral(2)) each.answer();
    EXPECT_EQ(next(errors).kind, TransportErrorKind::terminationImminent);
    EXPECT_TRUE(half.hears(1) && half.hears(2));
    half.socket.reset();
    expectInvalid();

    constexpr std::uint64_t count = maximumWaitingRequests + 100; // the end is seen while reading is paused
    std::string bytes;
    for (std::uint64_t id = 0; id < count; ++id) bytes += frame(Dictionary(), id);
    ready(bytes);
    const std::vector<Request> taken = takeSeveral(maximumWaitingRequests);
    expectService();
    EXPECT_EQ(errors.size() + requests.size(), 0U); // the others still wait
    for (const Request& each : taken) each.answer();
    const std::vector<Request> late = takeSeveral(count - maximumWaitingRequests); // the end does not wait for them
    expectInvalid();
}

TEST_F(TransportPeersTest, PeersAreTurnedAwayWithoutDescriptors) {
    if (support::checkerNeedsDescriptors) GTEST_SKIP() << "the checker needs descriptors itself";
    answers = true;
    start();
    RawPeer early = ready(frame(Dictionary(), 1));
    EXPECT_TRUE(early.hears(1));
    RawPeer late;
    rlimit limit{};
    ::getrlimit(RLIMIT_NOFILE, &limit);
    const auto lowestFree = static_cast<rlim_t>(RawPeer().socket.get());
    const rlimit tight{lowestFree, limit.rlim_max};
    ::setrlimit(RLIMIT_NOFILE, &tight);
    EXPECT_TRUE(callWithAddress(::connect, late, service));
    EXPECT_TRUE(late.isClosed());
    early.write(frame(Dictionary(), 2));
    EXPECT_TRUE(early.hears(2));
    ::setrlimit(RLIMIT_NOFILE, &limit);
    expectService();
}

TEST_F(TransportPeersTest, DescriptorsSentAlongAreNotKept) {
    answers = true;
    start();
    RawPeer peer = connected();
    std::string bytes = answerTo(peer.read(handshakeSize)) + frame(Dictionary());
    int ends[2];
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
    iovec part{bytes.data(), bytes.size()};
    const msghdr message{nullptr, 0, &part, 1, control.data(), control.size(), 0};
    *CMSG_FIRSTHDR(&message) = {CMSG_LEN(sizeof(int)), SOL_SOCKET, SCM_RIGHTS};
    std::memcpy(CMSG_DATA(CMSG_FIRSTHDR(&message)), &ends[1], sizeof(int));
    EXPECT_GT(::sendmsg(peer.socket.get(), &message, 0), 0);
    ::close(ends[1]);
    EXPECT_TRUE(peer.hears(1));
    char none = 0;
    EXPECT_EQ(::read(ends[0], &none, 1), 0); // the last of the pipe's other end is gone
    ::close(ends[0]);
}

TEST_F(TransportPeersTest, NamesAreSocketsAtPathsOfAnyLengthOrRefused) {
    root += "/" + std::string(100, 'd') + "/" + std::string(100, 'e');
    std::filesystem::create_directories(pathOf(""));
    EXPECT_TRUE(callWithAddress(::bind, RawPeer(), service)); // left behind by a process that was killed
    start();
    expectService();
    EXPECT_EQ(std::filesystem::status(pathOf(service)).permissions(), std::filesystem::perms(0666));
    for (const std::string name : {"", ".", "..", "a/b", ".hidden", "a.lock"}) {
        EXPECT_TRUE(transport->createListener(name, queues->makeSerial("other"))->refusal()) << name;
    }
}

TEST_F(TransportPeersTest, SocketThatWasPassedInIsServed) {
    std::filesystem::create_directories(pathOf(""));
    const struct {
        std::string file;
        std::string passedAs;
        bool isServed;
    } cases[] = {{service, "unit.socket", true}, {"elsewhere", service, true}, {"elsewhere", "unit.socket", false}};
    for (const auto& [file, passedAs, isServed] : cases) {
        SCOPED_TRACE(file + " as " + passedAs);
        const RawPeer passed;
        std::filesystem::remove(pathOf(file));
        EXPECT_TRUE(callWithAddress(::bind, passed, file));
        ::listen(passed.socket.get(), 5);
        RawPeer early;
        EXPECT_TRUE(callWithAddress(::connect, early, file));
        // Where a service manager passes it in.
        const Descriptor saved(::fcntl(3, F_DUPFD_CLOEXEC, 10));
        ::dup2(passed.socket.get(), 3);
        ::setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
        ::setenv("LISTEN_FDS", "1", 1);
        ::setenv("LISTEN_FDNAMES", passedAs.c_str(), 1);
        start();
        ::unsetenv("LISTEN_PID");
        if (!saved || ::dup2(saved.get(), 3) < 0) ::close(3);
        if (isServed) {
            early.write(answerTo(early.read(handshakeSize)) + frame(Dictionary()));
            take().answer();
            EXPECT_TRUE(early.hears(1));
        } else {
            expectService(); // on a socket of its own
        }
        transport = nullptr;
        EXPECT_TRUE(std::filesystem::exists(pathOf(file))); // the manager's to remove
    }
}

TEST_F(TransportPeersTest, EachRequestHasOneOutcomeWhateverEndsWhen) {
    start();
    const std::jthread answering([&] {
        for (Request next = take(); next.connection; next = take()) next.answer(*next.message.content.dictionary());
    });
    constexpr unsigned count = 20;
    const auto clientQueue = queues->makeSerial("client");
    Mailbox<bool> outcomes; // true: as it should be
    for (unsigned round = 0; round < 40; ++round) {
        const bool isCancelled = round % 2 == 1;
        const auto client = transport->connect(service, clientQueue);
        client->resume();
        const auto ask = [&] {
            for (unsigned i = 0; i < count; ++i) {
                const Dictionary message{{"n", i}};
                client->sendWithReply(message, clientQueue, [&, message](const ReplyOrError& reply) {
                    const auto* dictionary = std::get_if<Dictionary>(&reply);
                    outcomes.put(dictionary ? *dictionary == message : isCancelled);
                });
                if (isCancelled && i == round / 2) client->cancel();
            }
        };
        {
            const std::jthread others[] = {std::jthread(ask), std::jthread(ask)};
        }
        for (unsigned i = 0; i < 2 * count; ++i) EXPECT_EQ(outcomes.take(), true);
        client->cancel();
        clientQueue->sync([] {});
        EXPECT_EQ(outcomes.size(), 0U);
    }
    requests.put({});
}

} // namespace
