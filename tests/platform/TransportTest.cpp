#include "platform/linux/Transport.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/TransportConnection.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/Mailbox.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/TransportFake.h"
#include "tests/support/WorkQueueFake.h"

#include <gmock/gmock.h>

#include <atomic>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sys/wait.h>
#include <thread>

namespace {

using namespace platform;
using namespace platform::linux_;
using namespace platform::linux_::qmx;
using support::Mailbox;

/// A service on the transport under test that collects its requests, or answers each at once; and its clients.
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

    explicit TransportService(std::unique_ptr<platform::WorkQueues> made = std::make_unique<linux_::WorkQueues>())
        : queues(std::move(made)) {}

    /// Listens and gives each new connection to `accept`.
    std::shared_ptr<Listener> listen(std::function<void(const Peer&)> accept) {
        auto made = transport->createListener(service, queues->makeSerial("qmx"));
        made->setEventHandler([this, accept = std::move(accept)](const Listener::Event& event) {
            if (const auto* error = std::get_if<TransportError>(&event)) return errors.put(*error);
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
            if (!answers) return requests.put(request);
            request.answer(request.message.content.dictionary().value_or(Dictionary()));
        });
        connection->resume();
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

    /// Lets the twin, which has no threads, deliver what waits.
    void settle() {
        if (auto* const fake = dynamic_cast<support::FakeTransport*>(transport.get())) fake->deliver();
    }
    template <class T> T next(Mailbox<T>& mailbox) {
        settle();
        return mailbox.take().value();
    }
    Request take() { return next(requests); }
    void expectReply(const Dictionary& content = {}) { EXPECT_EQ(std::get<Dictionary>(next(replies)), content); }
    /// A connection has ended for a reason that is described with `part`.
    void expectInvalid(const std::string& part = "") { expectInvalid(next(errors), part); }
    static void expectInvalid(const TransportError& error, const std::string& part = "") {
        EXPECT_EQ(error.kind, TransportErrorKind::connectionInvalid);
        EXPECT_THAT(error.description, testing::HasSubstr(part));
    }

    const std::string service = "com.example.service";
    support::ScratchDirectory scratch;
    Mailbox<Request> requests;
    Mailbox<TransportError> errors; // at the listener and at accepted connections
    Mailbox<TransportError> clientErrors;
    Mailbox<ReplyOrError> replies;
    std::atomic<std::size_t> handled = 0; // requests and messages
    std::atomic<bool> answers = false;    // each request at once, by what it holds; else they are collected
    const std::unique_ptr<platform::WorkQueues> queues;
    const std::shared_ptr<WorkQueue> clientQueue = queues->makeSerial("client");
    std::unique_ptr<platform::Transport> transport; // goes first: nothing is delivered afterwards
};

std::unique_ptr<platform::WorkQueues> makeFakeQueues() {
    return std::make_unique<support::FakeWorkQueues>(support::FakeWorkQueues::Mode::inPlace);
}

/// The same cases run on sockets and on the twin.
class TransportTest : public TransportService, public testing::WithParamInterface<bool> {
protected:
    TransportTest() : TransportService(GetParam() ? std::make_unique<linux_::WorkQueues>() : makeFakeQueues()) {
        if (GetParam()) {
            transport = std::make_unique<linux_::Transport>(Root(scratch.path()));
        } else {
            auto fake = std::make_unique<support::FakeTransport>();
            fake->allowService(service);
            fake->setPeer({getpid(), getuid(), getgid(), nullptr});
            transport = std::move(fake);
        }
    }
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
    for (int n : {1, 2}) EXPECT_EQ(take().message.content, Value(Dictionary{{"n", n}}));
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
    };
    std::function<void(const Peer&)> end;
    const auto listener = listen([&end](const Peer& connection) { end(connection); });
    listener->resume();
    for (const auto& way : ways) {
        end = way;
        const auto client = connect();
        for (int i = 0; i < 2; ++i) ask(client);
        for (int i = 0; i < 2; ++i) expectInvalid(std::get<TransportError>(next(replies)));
        expectInvalid(next(clientErrors));
        EXPECT_EQ(clientErrors.size() + replies.size(), 0U);
    }
    EXPECT_EQ(handled, 2U); // a request and the end: nothing is delivered after the cancel
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
    /// The answer to the greeting, which comes first.
    std::string answer() {
        Handshake bytes{};
        EXPECT_EQ(read(handshakeSize).copy(bytes.data(), bytes.size()), handshakeSize);
        return {makeAnswer(bytes).data(), handshakeSize};
    }
    /// Whether this is the next reply.
    bool hears(std::uint64_t id, const Dictionary& content = {}) {
        const std::string expected = frame(content, id, FrameType::reply);
        return read(expected.size()) == expected;
    }
};

class TransportPeersTest : public TransportService {
protected:
    void start() {
        transport = std::make_unique<linux_::Transport>(Root(scratch.path()), limits);
        listener = serve();
    }
    std::string pathOf(const std::string& name) const { return scratch / "run/nordane/" + name; }
    /// `call` is bind(2) or connect(2).
    void callWithAddress(int (*call)(int, const sockaddr*, socklen_t), const RawPeer& peer, const std::string& name) {
        const auto use = [&](const sockaddr* to, socklen_t size) { return call(peer.socket.get(), to, size); };
        EXPECT_EQ(withSocketAddress(scratch / "run/nordane", name, use), 0);
    }
    RawPeer connected() {
        RawPeer peer;
        callWithAddress(::connect, peer, service);
        return peer;
    }
    /// Connected, with the handshake done, and `bytes` sent.
    RawPeer ready(const std::string& bytes = "") {
        RawPeer peer = connected();
        peer.write(peer.answer() + bytes);
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
            EXPECT_TRUE(ready(frame(Dictionary())).hears(1));
            expectInvalid();
        }
        answers = before;
    }

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
}

TEST_F(TransportPeersTest, OnlyTheConnectedProgramAnswersTheGreeting) {
    const std::function<void(RawPeer&, const std::string&)> impostors[] = {
        [](RawPeer& peer, const std::string& answer) { // another process, if only in part
            peer.write(answer.substr(0, 1));
            if (fork() > 0) return (void)peer.isClosed();
            peer.write(answer.substr(1));
        },
        [&](RawPeer& peer, const std::string& answer) { // another program in the same process
            const std::string file = scratch / "answer";
            std::ofstream(file, std::ios::binary) << answer;
            for (const int standard : {STDIN_FILENO, STDOUT_FILENO}) ::dup2(peer.socket.get(), standard);
            ::execlp("cat", "cat", file.c_str(), "-", nullptr);
        },
    };
    std::vector<pid_t> children;
    for (const auto& impostor : impostors) { // while this process has no other threads
        children.push_back(fork());
        if (children.back() > 0) continue;
        ::raise(SIGSTOP);
        RawPeer peer = connected();
        impostor(peer, peer.answer() + frame(Dictionary()));
        _exit(0);
    }
    answers = true;
    start();
    for (const pid_t child : children) {
        waitpid(child, nullptr, WUNTRACED);
        ::kill(child, SIGCONT);
        waitpid(child, nullptr, 0); // the service has closed its connection
    }
    RawPeer peer = connected();
    std::string answer = peer.answer();
    answer.back() ^= 1; // to another nonce
    peer.write(answer + frame(Dictionary()));
    EXPECT_TRUE(peer.isClosed());
    EXPECT_EQ(handled, 0U);
    peer = connected();
    for (const char byte : peer.answer() + frame(Dictionary())) peer.write({&byte, 1});
    EXPECT_TRUE(peer.hears(1));
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
        peer.write(peer.answer().substr(0, size));
        EXPECT_TRUE(peer.isClosed());
    }
    idle.write(frame(Dictionary(), 2)); // long after the deadline, which was for its handshake alone
    EXPECT_TRUE(idle.hears(2));
}

TEST_F(TransportPeersTest, WaitingMessagesAreBounded) {
    start();
    constexpr std::size_t large = 64 << 10;
    // Of which size, how many, and how many may still wait when more are taken.
    const std::tuple<FrameType, std::size_t, std::size_t, std::size_t> cases[] = {
        {FrameType::request, 0, maximumWaitingRequests, resumeWaitingRequests},
        {FrameType::message, 0, maximumWaitingRequests, resumeWaitingRequests},
        {FrameType::request, large, pauseWaitingBytes / large, resumeWaitingBytes / large - 1},
    };
    for (const auto& [type, size, bound, resumed] : cases) {
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
    // Of the user's own bound and of the overall one only the second lets small shares pass.
    const std::tuple<Budget::Share&, std::size_t, bool> cases[] = {
        {one, 10, true},  {another, 1, false}, {two, 6, false}, {two, 5, true},   {three, 3, false},
        {three, 2, true}, {two, 4, true},      {one, 0, true},  {three, 10, true}};
    for (const auto& [share, size, isGranted] : cases) EXPECT_EQ(share.resize(size), isGranted) << size;
}

TEST_F(TransportPeersTest, ReceivedBytesOfAUserAreBounded) {
    limits.received = {4 * mebibyte};
    constexpr std::size_t size = 900'000;
    const std::string large = frame(sized(size));
    start();
    std::vector<RawPeer> others; // the longest frames, only announced, are as good as nothing
    while (others.size() < 20) others.push_back(ready(std::string("\0\0\0\4", 4) + large.substr(4, 12)));
    // Messages count until they are dropped, also when their connection is gone.
    for (const FrameType type : {FrameType::request, FrameType::message}) {
        for (int i = 0; i < 2; ++i) {
            RawPeer asking = ready();
            for (std::uint64_t id = 0; asking.write(frame(sized(size), id, type)); ++id) {
            }
            expectInvalid("too many bytes of this user");
        }
        EXPECT_GE(requests.size(), 1U);
        EXPECT_LE(requests.size(), limits.received.perUser / size);
        takeSeveral(requests.size());
    }
    // Unfinished frames count together.
    for (int i = 0; i < 5; ++i) others.push_back(ready(large.substr(0, size)));
    expectInvalid("too many bytes of this user");
}

TEST_F(TransportPeersTest, PeerThatDoesNotReadHoldsItselfUpOnly) {
    constexpr std::size_t size = 64 << 10;
    constexpr std::uint64_t count = 400;
    const Dictionary large = sized(size);
    answers = true;
    start();
    RawPeer peer = ready();
    const std::jthread writer([&] {
        for (std::uint64_t id = 0; id < count; ++id) EXPECT_TRUE(peer.write(frame(large, id)));
    });
    expectService();
    // What the pause allows, one more turn, and what the socket's buffer holds.
    EXPECT_LE(handled, (pauseUnsentBytes + 2 * mebibyte) / size + framesPerTurn);
    for (std::uint64_t id = 0; id < count; ++id) ASSERT_TRUE(peer.hears(id, large)) << id;
}

TEST_F(TransportPeersTest, RepliesBeyondTheLimitsEndTheConnection) {
    start();
    RawPeer peer = ready(frame(Dictionary()));
    take().answer(sized(maximumFrameLength));
    EXPECT_TRUE(peer.isClosed());
    expectInvalid("too long");

    // What all connections of one user leave unread counts together.
    const Dictionary large = sized(16 * mebibyte);
    constexpr std::size_t fitting = 7;
    limits.unsent.perUser = (fitting + 1) * 16 * mebibyte;
    start();
    std::vector<RawPeer> peers;
    while (peers.size() < fitting + 3) peers.push_back(ready(frame(Dictionary())));
    const std::vector<Request> taken = takeSeveral(peers.size());
    for (std::size_t i = 0; i < fitting; ++i) taken[i].answer(large);
    expectService();
    EXPECT_EQ(errors.size(), 0U);
    for (std::size_t i = fitting; i < taken.size(); ++i) taken[i].answer(large);
    expectInvalid("does not read");
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

TEST_F(TransportPeersTest, SocketThatWasPassedInIsServed) {
    std::filesystem::create_directories(pathOf(""));
    answers = true;
    for (const auto& [file, passedAs] : {std::pair(service, "unit.socket"), {"elsewhere", service.c_str()}}) {
        const RawPeer passed;
        RawPeer peer;
        callWithAddress(::bind, passed, file);
        ::listen(passed.socket.get(), 5);
        callWithAddress(::connect, peer, file);
        // Where a service manager passes it in.
        const Descriptor saved(::fcntl(3, F_DUPFD_CLOEXEC, 10));
        ::dup2(passed.socket.get(), 3);
        ::setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
        ::setenv("LISTEN_FDS", "1", 1);
        ::setenv("LISTEN_FDNAMES", passedAs, 1);
        start();
        ::unsetenv("LISTEN_PID");
        if (!saved || ::dup2(saved.get(), 3) < 0) ::close(3);
        peer.write(peer.answer() + frame(Dictionary()));
        EXPECT_TRUE(peer.hears(1)) << file;
        transport = nullptr;
        EXPECT_TRUE(std::filesystem::exists(pathOf(file))); // the manager's to remove
    }
}

TEST_F(TransportPeersTest, EachRequestHasOneOutcomeWhateverEndsWhen) {
    answers = true;
    start();
    constexpr unsigned count = 20;
    for (unsigned round = 0; round < 2 * count; ++round) {
        const bool isCancelled = round % 2 == 1;
        const auto client = connect();
        for (unsigned i = 0; i < count; ++i) {
            ask(client, {{"n", i}});
            if (isCancelled && i == round / 2) client->cancel();
        }
        for (unsigned i = 0; i < count; ++i) {
            const ReplyOrError reply = next(replies);
            EXPECT_TRUE(isCancelled || std::get<Dictionary>(reply) == Dictionary({{"n", i}})) << i;
        }
        client->cancel();
        clientQueue->sync([] {});
        EXPECT_EQ(replies.size(), 0U);
    }
}

} // namespace
