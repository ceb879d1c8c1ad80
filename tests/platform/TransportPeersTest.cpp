#include "platform/linux/Descriptor.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/Transport.h"
#include "platform/linux/TransportConnection.h"
#include "platform/linux/TransportFrame.h"
#include "platform/linux/TransportLimits.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/Mailbox.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/ScratchDirectory.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <functional>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace {

using namespace platform;
using namespace platform::linux_;
using namespace platform::linux_::qmx;
using support::Mailbox;
using testing::HasSubstr;

constexpr const char* service = "com.example.service";

std::string frame(FrameType type, std::uint64_t id, const Value& content) {
    std::string bytes;
    appendFrame(bytes, type, id, content);
    return bytes;
}
std::string request(std::uint64_t id, const Value& content = Dictionary()) {
    return frame(FrameType::request, id, content);
}
std::string frameAround(const std::string& body) {
    std::string bytes = request(1).substr(0, frameHeaderSize) + body;
    const auto length = static_cast<std::uint32_t>(bytes.size() - frameLengthSize);
    std::memcpy(bytes.data(), &length, sizeof length);
    return bytes;
}
std::string nested(std::size_t depth) {
    Value value = Array();
    for (std::size_t i = 1; i < depth; ++i) value = Array{value};
    std::string body;
    appendCompact(body, value);
    return body;
}

/// A stranger's end of a connection: plain blocking calls. Reads give up after half a minute.
class RawPeer {
public:
    RawPeer() : socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        const timeval patience{30, 0};
        ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
        ::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    }
    bool connect(const std::string& root) {
        return withSocketAddress(root + "/run/nordane", service, [&](const sockaddr* address, socklen_t size) {
                   return ::connect(socket.get(), address, size);
               }) == 0;
    }
    /// Connected, with the handshake done.
    static RawPeer ready(const std::string& root) {
        RawPeer peer;
        EXPECT_TRUE(peer.connect(root));
        const auto greeting = peer.greeting();
        EXPECT_TRUE(greeting);
        if (greeting) peer.write(std::string(makeAnswer(*greeting).data(), handshakeSize));
        return peer;
    }
    std::optional<Handshake> greeting() {
        const std::string bytes = read(handshakeSize);
        if (bytes.size() != handshakeSize) return std::nullopt;
        Handshake greeting;
        std::copy(bytes.begin(), bytes.end(), greeting.begin());
        return greeting;
    }
    bool write(std::string_view bytes) {
        while (!bytes.empty()) {
            const ssize_t count = ::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
            if (count <= 0) return false;
            bytes.remove_prefix(static_cast<std::size_t>(count));
        }
        return true;
    }
    /// Fewer bytes when the other end closes first.
    std::string read(std::size_t size) {
        std::string bytes(size, '\0');
        std::size_t have = 0;
        while (have < size) {
            const ssize_t count = ::recv(socket.get(), bytes.data() + have, size - have, 0);
            if (count <= 0) break;
            have += static_cast<std::size_t>(count);
        }
        bytes.resize(have);
        return bytes;
    }
    /// The id of the next reply; none when there is no more.
    std::optional<std::uint64_t> reply() {
        std::string bytes = read(frameHeaderSize);
        if (bytes.size() < frameHeaderSize) return std::nullopt;
        std::uint32_t length = 0;
        std::memcpy(&length, bytes.data(), sizeof length);
        bytes += read(length + frameLengthSize - frameHeaderSize);
        const FrameScan scan = scanFrame(bytes);
        EXPECT_EQ(scan.outcome, FrameScan::Outcome::complete);
        EXPECT_EQ(scan.frame.type, FrameType::reply);
        return scan.frame.id;
    }
    bool isClosed() {
        char byte = 0;
        const ssize_t count = ::recv(socket.get(), &byte, 1, 0);
        return count == 0 || (count < 0 && errno == ECONNRESET);
    }

    Descriptor socket;
};

/// A service that collects its requests, or answers each at once.
class TransportPeersTest : public testing::Test {
protected:
    struct Request {
        std::shared_ptr<Connection> connection;
        ReceivedMessage message;
        void answer(const Value& with = true) const {
            ReplyMessage reply = createReply(message);
            reply.content.set("answer", with);
            connection->send(reply);
        }
    };

    void start(const std::string& root) {
        transport = std::make_unique<linux_::Transport>(Root(root));
        listener = transport->createListener(service, queues.makeSerial("qmx", QualityOfService::standard));
        listener->setEventHandler([this](const Listener::Event& event) {
            if (const auto* error = std::get_if<TransportError>(&event)) return listenerErrors.put(*error);
            const auto connection = std::get<std::shared_ptr<Connection>>(event);
            connections.put(connection->peerAuditToken());
            connection->setEventHandler([this, weak = std::weak_ptr(connection)](const ConnectionEvent& each) {
                if (const auto* error = std::get_if<TransportError>(&each)) return errors.put(*error);
                const Request received{weak.lock(), std::get<ReceivedMessage>(each)};
                ++handled;
                if (answers) {
                    serviceQueue->asyncOnCaller([this, received] { received.answer(content); });
                } else {
                    requests.put(received);
                }
            });
            connection->resume();
        });
        listener->resume();
    }
    void start() { start(scratch.path()); }

    /// The service does its work for others, and has dealt with all that came before.
    void expectService() {
        const bool before = answers.exchange(true);
        RawPeer peer = RawPeer::ready(scratch.path());
        peer.write(request(1));
        EXPECT_EQ(peer.reply(), 1U);
        answers = before;
    }
    void expectInvalid(const std::string& part) {
        const auto error = errors.take();
        ASSERT_TRUE(error);
        EXPECT_EQ(error->kind, TransportErrorKind::connectionInvalid);
        EXPECT_THAT(error->description, HasSubstr(part));
    }

    support::ScratchDirectory scratch;
    Mailbox<AuditToken> connections;
    Mailbox<Request> requests;
    Mailbox<TransportError> errors;
    Mailbox<TransportError> listenerErrors;
    std::atomic<std::size_t> handled = 0;
    std::atomic<bool> answers = false; // each request at once, with `content`; else they are collected
    Value content = true;              // set before `start`
    linux_::WorkQueues queues;
    std::shared_ptr<WorkQueue> serviceQueue = queues.makeSerial("service", QualityOfService::standard);
    std::unique_ptr<linux_::Transport> transport;
    std::shared_ptr<Listener> listener;
};

TEST_F(TransportPeersTest, MalformedDataEndsTheConnectionAndNothingElse) {
    start();
    const std::string good = request(7, Dictionary{{"n", 1}});
    auto changed = [&](std::size_t offset, char byte) {
        std::string bytes = good;
        bytes[offset] = byte;
        return bytes;
    };
    auto withLength = [&](std::uint32_t length) {
        std::string bytes(sizeof length, '\0');
        std::memcpy(bytes.data(), &length, sizeof length);
        return bytes;
    };
    std::string duplicateKeys = std::string("\x0b\x0c\0\0\0\x02\0\0\0", 9) + std::string("\x01\0\0\0k\x01", 6) +
                                std::string("\x01\0\0\0k\x01", 6);
    const struct {
        const char* name;
        std::string bytes;
        std::string text;
    } cases[] = {
        {"type 0", changed(4, 0), "frame type"},
        {"type 4", changed(4, 4), "frame type"},
        {"reserved byte", changed(7, 1), "reserved"},
        {"length below the header's", withLength(11), "too short"},
        {"length above the limit", withLength(maximumFrameLength + 1), "too long"},
        {"empty body", frameAround(""), "malformed"},
        {"unknown tag", frameAround("\xff"), "malformed"},
        {"bytes behind the value", frameAround("\x01\x01"), "malformed"},
        {"a key twice", frameAround(duplicateKeys), "malformed"},
        {"too deep", frameAround(nested(maximumNesting + 1)), "malformed"},
        {"reply to nothing", frame(FrameType::reply, 1, Dictionary()), "reply to no request"},
        {"id that still waits", good + good, "still waits"},
    };
    for (const auto& each : cases) {
        SCOPED_TRACE(each.name);
        RawPeer peer = RawPeer::ready(scratch.path());
        ASSERT_TRUE(peer.write(each.bytes));
        EXPECT_TRUE(peer.isClosed());
        expectInvalid(each.text);
    }
    EXPECT_EQ(handled, 1U); // the first of the two with one id

    RawPeer peer = RawPeer::ready(scratch.path());
    peer.write(good.substr(0, good.size() - 1));
    ::shutdown(peer.socket.get(), SHUT_WR);
    EXPECT_TRUE(peer.isClosed());
    expectInvalid("within a frame");

    // The other sides of the limits: nested as deep as allowed, and the longest length, which costs nothing unsent.
    answers = true;
    RawPeer deep = RawPeer::ready(scratch.path());
    deep.write(frameAround(nested(maximumNesting)));
    EXPECT_EQ(deep.reply(), 1U);
    deep.write(withLength(maximumFrameLength) + good.substr(4, 12));
    expectService();
    expectInvalid(""); // of that peer, which closed
    EXPECT_EQ(errors.size(), 0U);
}

TEST_F(TransportPeersTest, BytesMayComeOneByOne) {
    start();
    answers = true;
    RawPeer peer;
    ASSERT_TRUE(peer.connect(scratch.path()));
    const auto greeting = peer.greeting();
    ASSERT_TRUE(greeting);
    const Handshake reply = makeAnswer(*greeting);
    for (const char byte : std::string(reply.data(), reply.size()) + request(1) + request(2)) peer.write({&byte, 1});
    EXPECT_EQ(peer.reply(), 1U);
    EXPECT_EQ(peer.reply(), 2U);
}

/// What a process of its own does with a socket that this one shares and sees the end of.
int inChild(const std::function<void()>& work) {
    const pid_t child = fork();
    if (child == 0) {
        work();
        _exit(0);
    }
    int status = 0;
    waitpid(child, &status, 0);
    return status;
}

TEST_F(TransportPeersTest, OnlyTheConnectedProgramAnswersTheGreeting) {
    start();
    const std::string file = scratch / "answer";
    const struct {
        const char* name;
        std::function<void(RawPeer&, const Handshake&)> answer; // in the process that connected
        bool isAccepted;
    } cases[] = {
        {"the process itself",
         [](RawPeer& peer, const Handshake& greeting) {
             peer.write({makeAnswer(greeting).data(), handshakeSize});
             peer.write(request(1));
             peer.reply();
         },
         true},
        {"the greeting itself",
         [](RawPeer& peer, const Handshake& greeting) {
             peer.write({greeting.data(), greeting.size()});
             peer.isClosed();
         },
         false},
        {"another nonce",
         [](RawPeer& peer, const Handshake& greeting) {
             Handshake wrong = makeAnswer(greeting);
             wrong.back() = static_cast<char>(wrong.back() ^ 1);
             peer.write({wrong.data(), wrong.size()});
             peer.isClosed();
         },
         false},
        {"its child",
         [](RawPeer& peer, const Handshake& greeting) {
             inChild([&] { peer.write({makeAnswer(greeting).data(), handshakeSize}); });
             peer.isClosed(); // stays, so that the child's answer is all that is wrong
         },
         false},
        {"a child, for its last byte",
         [](RawPeer& peer, const Handshake& greeting) {
             const Handshake whole = makeAnswer(greeting);
             peer.write({whole.data(), handshakeSize - 1});
             inChild([&] { peer.write({&whole.back(), 1}); });
             peer.isClosed();
         },
         false},
        {"another program in its process",
         [&](RawPeer& peer, const Handshake& greeting) {
             std::ofstream(file, std::ios::binary).write(makeAnswer(greeting).data(), handshakeSize);
             ::dup2(peer.socket.get(), STDOUT_FILENO);
             ::execlp("tail", "tail", "-c", "24", "-f", file.c_str(), nullptr); // writes the answer and stays
         },
         false},
    };
    for (const auto& each : cases) {
        SCOPED_TRACE(each.name);
        RawPeer peer; // shared with the child, which connects it and so is its peer
        int greeted[2];
        ASSERT_EQ(::pipe2(greeted, O_CLOEXEC), 0);
        const Descriptor greetedOut(greeted[0]);
        Descriptor greetedIn(greeted[1]);
        const pid_t child = fork();
        if (child == 0) {
            if (!peer.connect(scratch.path())) _exit(1);
            const auto greeting = peer.greeting();
            if (!greeting) _exit(1);
            greetedIn.reset();
            each.answer(peer, *greeting);
            _exit(0);
        }
        greetedIn.reset();
        char none = 0;
        EXPECT_EQ(::read(greetedOut.get(), &none, 1), 0); // when the child has closed its end too
        if (each.isAccepted) {
            const auto received = requests.take();
            ASSERT_TRUE(received);
            EXPECT_EQ(received->connection->peerPid(), child);
            received->answer();
        } else {
            // Closed by the service: nothing else ends the connection while the child is there.
            EXPECT_TRUE(peer.isClosed());
        }
        ::kill(child, each.isAccepted ? 0 : SIGTERM);
        waitpid(child, nullptr, 0);
    }
    EXPECT_EQ(connections.size(), 1U);
}

TEST_F(TransportPeersTest, TokenNamesTheProcessAndItsProgram) {
    start();
    answers = true;
    const pid_t child = fork();
    if (child == 0) {
        RawPeer peer = RawPeer::ready(scratch.path());
        peer.write(request(1));
        peer.reply();
        peer.isClosed();
        _exit(0);
    }
    const auto token = connections.take();
    ASSERT_TRUE(token);
    EXPECT_EQ(token->pid, child);
    EXPECT_EQ(token->uid, getuid());
    EXPECT_EQ(token->gid, getgid());
    const auto process = std::dynamic_pointer_cast<const LinuxPeerProcess>(token->process);
    ASSERT_NE(process, nullptr);
    EXPECT_EQ(process->executablePath(), std::filesystem::read_symlink("/proc/self/exe"));
    EXPECT_EQ(process->program(), ProgramIdentity::ofProcess(getpid()));
    EXPECT_TRUE(process->isAlive());
    ::kill(child, SIGKILL);
    siginfo_t ended;
    waitid(P_PID, static_cast<id_t>(child), &ended, WEXITED | WNOWAIT);
    EXPECT_FALSE(process->isAlive()); // although the pid is still taken
    waitpid(child, nullptr, 0);
    EXPECT_FALSE(process->isUnchanged());
}

TEST_F(TransportPeersTest, WaitingRequestsAreBounded) {
    start();
    RawPeer peer = RawPeer::ready(scratch.path());
    constexpr std::size_t count = maximumWaitingRequests + 200;
    std::string bytes;
    for (std::uint64_t id = 0; id < count; ++id) bytes += request(id, Dictionary{{"n", id}});
    ASSERT_TRUE(peer.write(bytes));
    std::vector<Request> taken;
    for (std::size_t i = 0; i < maximumWaitingRequests; ++i) taken.push_back(*requests.take());
    expectService();
    EXPECT_EQ(requests.size(), 0U);
    // Half are let go, some answered and some not: the rest comes, in order.
    for (std::size_t i = 0; i < resumeWaitingRequests; ++i) taken[i].answer();
    taken.erase(taken.begin() + resumeWaitingRequests, taken.end());
    for (std::uint64_t id = maximumWaitingRequests; id < count; ++id) {
        const auto next = requests.take();
        ASSERT_TRUE(next);
        EXPECT_EQ(next->message.content, Value(Dictionary{{"n", id}}));
        if (id % 2 == 0) next->answer();
    }
    taken.clear();
    for (std::uint64_t id = 0; id < resumeWaitingRequests; ++id) EXPECT_EQ(peer.reply(), id);
}

TEST_F(TransportPeersTest, PeerThatDoesNotReadHoldsItselfUpOnly) {
    constexpr std::size_t size = 64 << 10;
    content = Value::data(std::string(size, 'x'));
    answers = true;
    start();
    RawPeer peer = RawPeer::ready(scratch.path());
    constexpr std::uint64_t count = 400;
    std::string bytes;
    for (std::uint64_t id = 0; id < count; ++id) bytes += request(id);
    ASSERT_TRUE(peer.write(bytes));
    expectService();
    expectService();
    const std::size_t before = handled;
    // What the pause allows, one more turn, and what the socket's buffer holds.
    EXPECT_LE(before, (pauseUnsentBytes + (2U << 20U)) / size + framesPerTurn);
    for (std::uint64_t id = 0; id < count; ++id) ASSERT_EQ(peer.reply(), id);
    EXPECT_EQ(handled, count + 2);
}

TEST_F(TransportPeersTest, TooManyUnreadBytesEndTheConnection) {
    start();
    RawPeer peer = RawPeer::ready(scratch.path());
    const Value large = Value::data(std::string(16U << 20U, 'x'));
    constexpr std::size_t fitting = maximumUnsentBytes / (16U << 20U) - 1;
    for (std::uint64_t id = 0; id < fitting + 3; ++id) peer.write(request(id));
    std::vector<Request> taken;
    for (std::size_t i = 0; i < fitting + 3; ++i) taken.push_back(*requests.take());
    for (std::size_t i = 0; i < fitting; ++i) taken[i].answer(large);
    expectService();
    expectInvalid(""); // of that peer, which closed
    EXPECT_EQ(errors.size(), 0U);
    for (std::size_t i = fitting; i < fitting + 3; ++i) taken[i].answer(large);
    expectInvalid("does not read");
}

TEST_F(TransportPeersTest, ReplyBeyondTheLengthLimitEndsTheConnection) {
    start();
    RawPeer peer = RawPeer::ready(scratch.path());
    peer.write(request(1));
    const auto received = requests.take();
    ASSERT_TRUE(received);
    received->answer(Value::data(std::string(maximumFrameLength, 'x')));
    EXPECT_TRUE(peer.isClosed());
    expectInvalid("too long");
}

TEST_F(TransportPeersTest, HalfClosedPeerStillGetsItsReplies) {
    start();
    RawPeer peer = RawPeer::ready(scratch.path());
    peer.write(request(1) + request(2));
    ::shutdown(peer.socket.get(), SHUT_WR);
    const auto first = requests.take();
    const auto second = requests.take();
    ASSERT_TRUE(first && second);
    const auto imminent = errors.take();
    ASSERT_TRUE(imminent);
    EXPECT_EQ(imminent->kind, TransportErrorKind::terminationImminent);
    first->answer();
    second->answer();
    EXPECT_EQ(peer.reply(), 1U);
    EXPECT_EQ(peer.reply(), 2U);
    EXPECT_EQ(errors.size(), 0U);
    peer.socket.reset();
    expectInvalid("");
}

TEST_F(TransportPeersTest, RequestsOfAPeerThatIsGoneComeBeforeItsEnd) {
    start();
    constexpr std::uint64_t count = maximumWaitingRequests + 100; // its end is seen while reading is paused
    {
        RawPeer peer = RawPeer::ready(scratch.path());
        std::string bytes;
        for (std::uint64_t id = 0; id < count; ++id) bytes += request(id);
        peer.write(bytes);
        ASSERT_TRUE(connections.take());
    }
    std::vector<Request> taken;
    for (std::size_t i = 0; i < maximumWaitingRequests; ++i) taken.push_back(*requests.take());
    expectService();
    expectInvalid(""); // of `expectService`'s peer: the other one's requests still wait
    EXPECT_EQ(errors.size(), 0U);
    for (const auto& each : taken) each.answer();
    for (std::uint64_t id = maximumWaitingRequests; id < count; ++id) {
        const auto next = requests.take();
        ASSERT_TRUE(next);
        if (id + 1 < count) next->answer();
    }
    expectInvalid("");
}

TEST_F(TransportPeersTest, ManyPipelinedRequestsAreAnsweredInOrder) {
    start();
    answers = true;
    RawPeer peer = RawPeer::ready(scratch.path());
    constexpr std::uint64_t count = 10'000;
    std::jthread writer([&] {
        std::string bytes;
        for (std::uint64_t id = 0; id < count; ++id)
            bytes += request(id, Dictionary{{"padding", std::string(100, 'p')}});
        EXPECT_TRUE(peer.write(bytes));
    });
    for (std::uint64_t id = 0; id < count; ++id) ASSERT_EQ(peer.reply(), id);
}

TEST_F(TransportPeersTest, ConnectionsOfOneUserAreBounded) {
    rlimit limit{};
    ::getrlimit(RLIMIT_NOFILE, &limit);
    if (limit.rlim_max < 5000) GTEST_SKIP() << "needs 5,000 descriptors";
    start();
    answers = true;
    // Peers that say nothing count like others, and cost others nothing.
    std::vector<RawPeer> peers(2000);
    for (RawPeer& peer : peers) ASSERT_TRUE(peer.connect(scratch.path()));
    for (std::size_t i = 0; i < maximumConnectionsPerUser; ++i) ASSERT_TRUE(peers[i].greeting()) << i;
    for (std::size_t i = maximumConnectionsPerUser; i < peers.size(); ++i) ASSERT_TRUE(peers[i].isClosed()) << i;
    peers.pop_back();
    peers.erase(peers.begin() + 10, peers.begin() + 20);
    // The service hears of those ends in its own time.
    bool isServed = false;
    while (!isServed) {
        RawPeer peer;
        ASSERT_TRUE(peer.connect(scratch.path()));
        isServed = peer.greeting().has_value();
    }
    expectService();
}

TEST_F(TransportPeersTest, PeersAreTurnedAwayWithoutDescriptors) {
    if (support::checkerNeedsDescriptors) GTEST_SKIP() << "the checker needs descriptors itself";
    answers = true;
    start();
    RawPeer early = RawPeer::ready(scratch.path());
    early.write(request(1));
    EXPECT_EQ(early.reply(), 1U);
    RawPeer late;
    rlimit limit{};
    ::getrlimit(RLIMIT_NOFILE, &limit);
    Descriptor lowestFree(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    const rlimit tight{static_cast<rlim_t>(lowestFree.get()), limit.rlim_max};
    lowestFree.reset();
    ::setrlimit(RLIMIT_NOFILE, &tight);
    EXPECT_TRUE(late.connect(scratch.path()));
    EXPECT_TRUE(late.isClosed());
    early.write(request(2));
    EXPECT_EQ(early.reply(), 2U);
    ::setrlimit(RLIMIT_NOFILE, &limit);
    expectService();
}

TEST_F(TransportPeersTest, DescriptorsSentAlongAreNotKept) {
    start();
    answers = true;
    auto openDescriptors = [] {
        return std::distance(std::filesystem::directory_iterator("/proc/self/fd"),
                             std::filesystem::directory_iterator());
    };
    RawPeer peer = RawPeer::ready(scratch.path());
    peer.write(request(1));
    EXPECT_EQ(peer.reply(), 1U);
    const auto before = openDescriptors();
    for (std::uint64_t id = 2; id < 20; ++id) {
        std::string bytes = request(id);
        iovec part{bytes.data(), bytes.size()};
        alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
        msghdr message{};
        message.msg_iov = &part;
        message.msg_iovlen = 1;
        message.msg_control = control.data();
        message.msg_controllen = control.size();
        cmsghdr* const header = CMSG_FIRSTHDR(&message);
        header->cmsg_level = SOL_SOCKET;
        header->cmsg_type = SCM_RIGHTS;
        header->cmsg_len = CMSG_LEN(sizeof(int));
        const int sent = peer.socket.get();
        std::memcpy(CMSG_DATA(header), &sent, sizeof sent);
        ASSERT_EQ(::sendmsg(peer.socket.get(), &message, 0), static_cast<ssize_t>(bytes.size()));
    }
    for (std::uint64_t id = 2; id < 20; ++id) EXPECT_EQ(peer.reply(), id);
    EXPECT_EQ(openDescriptors(), before);
}

TEST_F(TransportPeersTest, NameIsHeldByOneProcessAndFreeWhenItIsGone) {
    // What a process that was killed leaves behind.
    std::filesystem::create_directories(scratch / "run/nordane");
    std::ofstream(scratch / ("run/nordane/" + std::string(service) + ".lock"));
    {
        const Descriptor stale(::socket(AF_UNIX, SOCK_STREAM, 0));
        withSocketAddress(scratch / "run/nordane", service,
                          [&](const sockaddr* address, socklen_t size) { return ::bind(stale.get(), address, size); });
    }
    start();
    expectService();
    const std::string path = scratch / ("run/nordane/" + std::string(service));
    EXPECT_EQ(std::filesystem::status(path).permissions(), std::filesystem::perms(0666));

    const auto first = std::exchange(listener, nullptr);
    auto other = std::exchange(transport, nullptr);
    start(); // as another daemon does
    const auto error = listenerErrors.take();
    ASSERT_TRUE(error);
    EXPECT_EQ(error->kind, TransportErrorKind::other);
    transport = nullptr;
    expectService(); // the first has kept its socket
    other = nullptr;
    EXPECT_FALSE(std::filesystem::exists(path));
    start();
    expectService();
    EXPECT_EQ(listenerErrors.size(), 0U);
}

TEST_F(TransportPeersTest, BadNamesAreRefused) {
    transport = std::make_unique<linux_::Transport>(Root(scratch.path()));
    for (const std::string name : {"", ".", "..", "a/b", ".hidden", "a.lock"}) {
        const auto refused = transport->createListener(name, serviceQueue);
        refused->setEventHandler(
            [&](const Listener::Event& event) { listenerErrors.put(std::get<TransportError>(event)); });
        refused->resume();
        EXPECT_TRUE(listenerErrors.take()) << name;
    }
}

TEST_F(TransportPeersTest, PathLongerThanASocketAddress) {
    const std::string root = scratch / (std::string(100, 'd') + "/" + std::string(100, 'e'));
    start(root);
    const auto client = transport->connect(service, serviceQueue);
    client->resume();
    answers = true;
    Mailbox<ReplyOrError> replies;
    client->sendWithReply({}, queues.makeSerial("client", QualityOfService::standard),
                          [&](const ReplyOrError& reply) { replies.put(reply); });
    const auto reply = replies.take();
    ASSERT_TRUE(reply);
    EXPECT_TRUE(std::holds_alternative<Dictionary>(*reply));
    EXPECT_TRUE(std::filesystem::is_socket(root + "/run/nordane/" + service));
}

/// Puts a socket where a service manager passes it in.
class PassedSocket {
public:
    PassedSocket(int socket, const char* name) : _saved(::fcntl(3, F_DUPFD_CLOEXEC, 10)) {
        ::dup2(socket, 3);
        ::setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
        ::setenv("LISTEN_FDS", "1", 1);
        ::setenv("LISTEN_FDNAMES", name, 1);
    }
    ~PassedSocket() {
        for (const char* variable : {"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES"}) ::unsetenv(variable);
        if (_saved) {
            ::dup2(_saved.get(), 3);
        } else {
            ::close(3);
        }
    }

private:
    const Descriptor _saved;
};

TEST_F(TransportPeersTest, SocketThatWasPassedInIsServed) {
    std::filesystem::create_directories(scratch / "run/nordane");
    const struct {
        const char* name;
        const char* fdName;
        bool isServed;
    } cases[] = {
        {"by its path", "unit.socket", true}, {"by its name", service, true}, {"not ours", "unit.socket", false}};
    for (const auto& each : cases) {
        SCOPED_TRACE(each.name);
        const Descriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        const bool isElsewhere = std::string_view(each.fdName) == service || !each.isServed;
        const char* file = isElsewhere ? "elsewhere" : service;
        std::filesystem::remove(scratch / ("run/nordane/" + std::string(file)));
        withSocketAddress(scratch / "run/nordane", file,
                          [&](const sockaddr* address, socklen_t size) { return ::bind(socket.get(), address, size); });
        ::listen(socket.get(), 5);
        RawPeer early;
        ASSERT_EQ(withSocketAddress(scratch / "run/nordane", file,
                                    [&](const sockaddr* address, socklen_t size) {
                                        return ::connect(early.socket.get(), address, size);
                                    }),
                  0);
        const PassedSocket passed(socket.get(), each.fdName);
        start();
        if (each.isServed) {
            const auto greeting = early.greeting();
            ASSERT_TRUE(greeting);
            early.write(std::string(makeAnswer(*greeting).data(), handshakeSize) + request(1));
            const auto received = requests.take();
            ASSERT_TRUE(received);
            received->answer();
            EXPECT_EQ(early.reply(), 1U);
        } else {
            expectService(); // on a socket of its own
        }
        transport = nullptr;
        EXPECT_TRUE(std::filesystem::exists(scratch / ("run/nordane/" + std::string(file)))); // the manager's to remove
    }
}

TEST_F(TransportPeersTest, EndsMayComeAtAnyMoment) {
    content = Value::data(std::string(2000, 'x'));
    answers = true;
    start();
    std::vector<std::jthread> threads;
    for (unsigned thread = 0; thread < 4; ++thread) {
        threads.emplace_back([&, thread] {
            const auto queue = queues.makeSerial("client", QualityOfService::standard);
            for (unsigned round = 0; round < 40; ++round) {
                Mailbox<bool> replies;
                const auto client = transport->connect(service, queue);
                client->resume();
                constexpr unsigned count = 20;
                for (unsigned i = 0; i < count; ++i) {
                    client->sendWithReply({}, queue, [&](const ReplyOrError&) { replies.put(true); });
                    if (i == (round + thread) % (2 * count)) client->cancel();
                }
                // Exactly one outcome each, whatever happened.
                for (unsigned i = 0; i < count; ++i) ASSERT_TRUE(replies.take());
                client->cancel();
                queue->sync([] {});
                EXPECT_EQ(replies.size(), 0U);
            }
        });
    }
    threads.clear();
    expectService();
}

} // namespace
