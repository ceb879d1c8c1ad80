#include "platform/linux/Descriptor.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/Transport.h"
#include "platform/linux/TransportConnection.h"
#include "platform/linux/TransportFrame.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/TransportService.h"

#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace {

using namespace platform;
using namespace platform::linux_;
using namespace platform::linux_::qmx;

constexpr std::size_t mebibyte = std::size_t{1} << 20U;

std::string frame(FrameType type, std::uint64_t id, const Value& content) {
    std::string bytes;
    appendFrame(bytes, type, id, content);
    return bytes;
}
/// A message with its number and about so many bytes more.
std::string numbered(std::uint64_t id, std::size_t padding = 0, FrameType type = FrameType::request) {
    return frame(type, id, Dictionary{{"n", id}, {"padding", Value::data(std::string(padding, 'x'))}});
}
std::string number(std::size_t value) {
    const auto field = static_cast<std::uint32_t>(value);
    return {reinterpret_cast<const char*>(&field), sizeof field};
}
std::string frameAround(const std::string& body) {
    const std::string header = numbered(1).substr(frameLengthSize, frameHeaderSize - frameLengthSize);
    return number(header.size() + body.size()) + header + body;
}
std::string array(std::size_t count, const std::string& items) {
    return "\x0a" + number(items.size()) + number(count) + items;
}
std::string nested(std::size_t depth) { return depth == 0 ? "" : array(depth > 1 ? 1 : 0, nested(depth - 1)); }

/// A stranger's end of a connection: plain blocking calls, which give up after half a minute.
class RawPeer {
public:
    RawPeer() : socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        const timeval patience{30, 0};
        ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
        ::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    }
    bool write(std::string_view bytes) {
        const ssize_t count = ::send(socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
        return count == static_cast<ssize_t>(bytes.size());
    }
    /// Empty when the other end closes first.
    std::string read(std::size_t size) {
        std::string bytes(size, '\0');
        return ::recv(socket.get(), bytes.data(), size, MSG_WAITALL) == static_cast<ssize_t>(size) ? bytes : "";
    }
    std::optional<Handshake> greeting() {
        Handshake greeting;
        return read(handshakeSize).copy(greeting.data(), handshakeSize) == 0 ? std::nullopt : std::optional(greeting);
    }
    static std::string answer(const Handshake& greeting) { return {makeAnswer(greeting).data(), handshakeSize}; }
    /// The id of the next reply; none when there is no more.
    std::optional<std::uint64_t> reply() {
        std::string bytes = read(frameHeaderSize);
        if (bytes.empty()) return std::nullopt;
        std::uint32_t length = 0;
        std::memcpy(&length, bytes.data(), sizeof length);
        bytes += read(length + frameLengthSize - frameHeaderSize);
        const FrameScan scan = scanFrame(bytes);
        EXPECT_TRUE(scan.outcome == FrameScan::Outcome::complete && scan.frame.type == FrameType::reply);
        return scan.frame.id;
    }
    void expectReplies(std::uint64_t first, std::uint64_t end) {
        for (std::uint64_t id = first; id < end; ++id) ASSERT_EQ(reply(), id);
    }
    bool isClosed() {
        char byte = 0;
        const ssize_t count = ::recv(socket.get(), &byte, 1, 0);
        return count == 0 || (count < 0 && errno == ECONNRESET);
    }

    Descriptor socket;
};

class TransportPeersTest : public support::TransportService {
protected:
    TransportPeersTest() { queues = std::make_unique<linux_::WorkQueues>(); }
    void start() {
        transport = std::make_unique<linux_::Transport>(Root(root), limits);
        listener = serve();
    }
    std::string pathOf(const std::string& name) const { return root + "/run/nordane/" + name; }
    template <class Call> bool callWithAddress(Call call, const Descriptor& socket, const char* name = service) {
        return withSocketAddress(root + "/run/nordane", name, [&](const sockaddr* address, socklen_t size) {
                   return call(socket.get(), address, size);
               }) == 0;
    }
    bool connect(RawPeer& peer) { return callWithAddress(::connect, peer.socket); }
    /// Connected, with the handshake done, and `bytes` sent.
    RawPeer ready(const std::string& bytes = "") {
        RawPeer peer;
        EXPECT_TRUE(connect(peer));
        const auto greeting = peer.greeting();
        EXPECT_TRUE(greeting);
        if (greeting) peer.write(RawPeer::answer(*greeting) + bytes);
        return peer;
    }
    std::vector<Request> takeSeveral(std::size_t count) {
        std::vector<Request> taken;
        for (std::size_t i = 0; i < count; ++i) taken.push_back(take());
        return taken;
    }
    /// The service does its work for others, and has dealt with all that came before.
    void expectService() {
        const bool before = answers.exchange(true);
        RawPeer peer = ready(numbered(1));
        EXPECT_EQ(peer.reply(), 1U);
        answers = before;
        peer.socket.reset();
        expectInvalid();
    }

    std::string root = scratch.path();
    Limits limits;
    std::shared_ptr<Listener> listener;
};

TEST_F(TransportPeersTest, MalformedDataEndsTheConnectionAndNothingElse) {
    start();
    const std::string good = numbered(7);
    auto changed = [&](std::size_t offset, char byte) { return std::string(good).replace(offset, 1, 1, byte); };
    const std::string entry("\x01\0\0\0k\x01", 6);
    std::string claims; // an array in an array and so on, each of as many items as it has bytes
    for (std::size_t i = 1; i < maximumNesting; ++i) claims = array(9 + claims.size(), claims + array(0, ""));
    const struct {
        const char* name;
        std::string bytes;
        const char* text;
    } cases[] = {
        {"type 0", changed(4, 0), "frame type"},
        {"type 4", changed(4, 4), "frame type"},
        {"reserved byte", changed(7, 1), "reserved"},
        {"length below the header's", number(11), "too short"},
        {"length above the limit", number(maximumFrameLength + 1), "too long"},
        {"empty body", frameAround(""), "malformed"},
        {"unknown tag", frameAround("\xff"), "malformed"},
        {"bytes behind the value", frameAround("\x01\x01"), "malformed"},
        {"a key twice", frameAround("\x0b" + number(12) + number(2) + entry + entry), "malformed"},
        {"too deep", frameAround(nested(maximumNesting + 1)), "malformed"},
        {"items beyond the bytes", frameAround(claims), "count is larger"},
        {"sixteen bytes of memory for each of its own",
         frameAround(array(maximumDecodedBytes / sizeof(Value), std::string(maximumDecodedBytes / sizeof(Value), 1))),
         "too much memory"},
        {"reply to nothing", frame(FrameType::reply, 1, Dictionary()), "reply to no request"},
        {"id that still waits", good + good, "still waits"},
    };
    for (const auto& each : cases) {
        SCOPED_TRACE(each.name);
        RawPeer peer = ready();
        ASSERT_TRUE(peer.write(each.bytes));
        EXPECT_TRUE(peer.isClosed());
        expectInvalid(each.text);
    }
    EXPECT_EQ(handled, 1U); // the first of the two with one id

    RawPeer peer = ready(good.substr(0, good.size() - 1));
    ::shutdown(peer.socket.get(), SHUT_WR);
    EXPECT_TRUE(peer.isClosed());
    expectInvalid("within a frame");
}

TEST_F(TransportPeersTest, LargestMessagesPass) {
    start();
    answers = true;
    // Nested as deep as allowed; and as long, of texts as they are in messages.
    std::string text = "\x07" + number(59) + std::string(59, 't');
    std::string texts;
    const std::size_t count = (maximumFrameLength - 100) / text.size();
    for (std::size_t i = 0; i < count; ++i) texts += text;
    for (const std::string& body : {nested(maximumNesting), array(count, texts)}) {
        EXPECT_EQ(ready(frameAround(body)).reply(), 1U);
        expectInvalid();
    }
}

/// What a process of its own does with a socket that this one shares and sees the end of.
pid_t inChild(const std::function<void()>& work) {
    const pid_t child = fork();
    if (child == 0) {
        work();
        _exit(0);
    }
    return child;
}

TEST_F(TransportPeersTest, OnlyTheConnectedProgramAnswersTheGreeting) {
    start();
    const std::string file = scratch / "answer";
    auto childWrites = [](RawPeer& peer, const std::string& bytes) {
        waitpid(inChild([&] { peer.write(bytes); }), nullptr, 0);
    };
    const struct {
        const char* name;
        std::function<void(RawPeer&, const Handshake&)> write; // in the process that connected; it stays afterwards
        bool isAccepted = false;
    } cases[] = {
        {"the process itself",
         [](RawPeer& peer, const Handshake& greeting) { peer.write(RawPeer::answer(greeting) + numbered(1)); }, true},
        {"the greeting itself",
         [](RawPeer& peer, const Handshake& greeting) { peer.write({greeting.data(), greeting.size()}); }},
        {"another nonce",
         [](RawPeer& peer, Handshake greeting) {
             greeting.back() = static_cast<char>(greeting.back() ^ 1);
             peer.write(RawPeer::answer(greeting));
         }},
        {"its child", [&](RawPeer& peer, const Handshake& greeting) { childWrites(peer, RawPeer::answer(greeting)); }},
        {"a child, for its last byte",
         [&](RawPeer& peer, const Handshake& greeting) {
             peer.write(RawPeer::answer(greeting).substr(0, handshakeSize - 1));
             childWrites(peer, RawPeer::answer(greeting).substr(handshakeSize - 1));
         }},
        {"another program in its process",
         [&](RawPeer& peer, const Handshake& greeting) {
             std::ofstream(file, std::ios::binary) << RawPeer::answer(greeting);
             ::dup2(peer.socket.get(), STDOUT_FILENO);
             ::execlp("tail", "tail", "-c", "24", "-f", file.c_str(), nullptr); // writes the answer and stays
         }},
    };
    for (const auto& each : cases) {
        SCOPED_TRACE(each.name);
        RawPeer peer; // shared with the child, which connects it and so is its peer
        const pid_t child = inChild([&] {
            const auto greeting = connect(peer) ? peer.greeting() : std::nullopt;
            ::raise(SIGSTOP);
            if (greeting) each.write(peer, *greeting);
            peer.isClosed();
        });
        waitpid(child, nullptr, WUNTRACED); // until it has read the greeting, which is not for this process
        ::kill(child, SIGCONT);
        if (each.isAccepted) {
            EXPECT_EQ(take().connection->peerPid(), child);
        } else {
            EXPECT_TRUE(peer.isClosed()); // by the service: nothing else ends it while the child is there
        }
        ::kill(child, SIGTERM);
        waitpid(child, nullptr, 0);
    }
    EXPECT_EQ(accepted, 1U);
}

TEST_F(TransportPeersTest, TokenNamesTheProcessAndItsProgram) {
    start();
    const pid_t child = inChild([&] { ready(numbered(1)).isClosed(); });
    const AuditToken token = take().connection->peerAuditToken();
    EXPECT_EQ(token.pid, child);
    EXPECT_EQ(token.uid, getuid());
    EXPECT_EQ(token.gid, getgid());
    const auto process = std::dynamic_pointer_cast<const LinuxPeerProcess>(token.process);
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

TEST_F(TransportPeersTest, UnfinishedHandshakesEnd) {
    limits.handshake = std::chrono::milliseconds(20);
    limits.connections.perUser = 2;
    start();
    answers = true;
    RawPeer idle;
    while (idle.reply() != 1U) idle = ready(numbered(1)); // on a busy machine not the first time
    // Each is there longer than the one before; each has the second place.
    for (const std::size_t size : {std::size_t{0}, handshakeSize - 1}) {
        RawPeer peer;
        ASSERT_TRUE(connect(peer));
        const auto greeting = peer.greeting();
        ASSERT_TRUE(greeting);
        peer.write(RawPeer::answer(*greeting).substr(0, size));
        EXPECT_TRUE(peer.isClosed());
    }
    idle.write(numbered(2)); // long after the deadline, which was for its handshake alone
    EXPECT_EQ(idle.reply(), 2U);
}

TEST_F(TransportPeersTest, WaitingMessagesAreBounded) {
    start();
    constexpr std::size_t large = 64 << 10;
    const struct {
        const char* name;
        FrameType type;
        std::size_t padding;
        std::size_t bound;
        std::size_t resumed; // and fewer
    } cases[] = {
        {"requests", FrameType::request, 0, maximumWaitingRequests, resumeWaitingRequests},
        {"messages without reply", FrameType::message, 0, maximumWaitingRequests, resumeWaitingRequests},
        {"large requests", FrameType::request, large, pauseWaitingBytes / large, resumeWaitingBytes / large - 1},
    };
    for (const auto& each : cases) {
        SCOPED_TRACE(each.name);
        RawPeer peer = ready();
        const std::size_t count = 2 * each.bound;
        std::jthread writer([&] {
            for (std::uint64_t id = 0; id < count; ++id) peer.write(numbered(id, each.padding, each.type));
        });
        std::vector<Request> taken = takeSeveral(each.bound);
        expectService();
        expectService();
        EXPECT_EQ(requests.size(), 0U);
        // Half are let go, some answered and some not: the rest comes, in order.
        for (std::size_t i = 0; i < each.bound - each.resumed; ++i) taken[i].answer();
        taken.erase(taken.begin(), taken.end() - static_cast<std::ptrdiff_t>(each.resumed));
        for (std::uint64_t id = each.bound; id < count; ++id) {
            const Request next = take();
            EXPECT_EQ(next.message.content.dictionary().value_or(Dictionary())["n"], Value(id));
            if (id % 2 == 0) next.answer();
        }
        if (each.type == FrameType::request) peer.expectReplies(0, each.bound - each.resumed);
        // What still waits does so no longer for a connection that is gone.
        writer.join();
        peer.socket.reset();
        expectInvalid();
        taken.clear();
    }
    expectService();
}

TEST(TransportBudget, UsersShareButOrdinarySharesPass) {
    const auto budget = std::make_shared<Budget>(Budget::Limits{10, 15, 2});
    Budget::Share first = budget->shareOf(1);
    EXPECT_TRUE(first.resize(10));
    EXPECT_FALSE(first.sibling().resize(1)); // the user's own bound is for small shares too
    Budget::Share second = budget->shareOf(2);
    EXPECT_FALSE(second.resize(6));
    EXPECT_TRUE(second.resize(5));
    Budget::Share third = budget->shareOf(3);
    EXPECT_FALSE(third.resize(3)); // all are used up
    EXPECT_TRUE(third.resize(2));
    EXPECT_FALSE(third.resize(std::numeric_limits<std::size_t>::max()));
    EXPECT_TRUE(second.resize(4)); // giving back is always possible
    first = {};
    EXPECT_TRUE(third.resize(10));
    EXPECT_TRUE(budget->shareOf(1).resize(1));
}

TEST_F(TransportPeersTest, ReceivedBytesOfAUserAreBounded) {
    limits.received = {4 * mebibyte};
    const char* const text = "too many bytes of this user";
    constexpr std::size_t large = 900'000;
    start();
    std::vector<RawPeer> announcing; // as good as nothing
    for (int i = 0; i < 20; ++i) announcing.push_back(ready(number(maximumFrameLength) + numbered(1).substr(4, 12)));
    // Messages count until they are dropped, also when their connection is gone.
    for (const FrameType type : {FrameType::request, FrameType::message}) {
        SCOPED_TRACE(static_cast<int>(type));
        for (int i = 0; i < 3; ++i) {
            RawPeer peer = ready();
            for (std::uint64_t id = 0; id < 10 && peer.write(numbered(id, large, type)); ++id) {
            }
            ASSERT_TRUE(peer.isClosed());
            expectInvalid(text);
        }
        EXPECT_GE(requests.size(), 1U);
        EXPECT_LE(requests.size(), limits.received.perUser / large);
        takeSeveral(requests.size());
    }
    // Unfinished frames of several connections.
    std::vector<RawPeer> unfinished;
    for (int i = 0; i < 5; ++i) (unfinished.emplace_back(ready())).write(numbered(1, large).substr(0, large));
    expectInvalid(text);
    unfinished.clear();
    for (int i = 0; i < 4; ++i) expectInvalid();
    // An answer ends the waiting, though the request is still held.
    RawPeer peer = ready();
    std::vector<Request> held;
    for (std::uint64_t id = 0; id < 8; ++id) {
        peer.write(numbered(id, large));
        held.push_back(take());
        held.back().answer();
        EXPECT_EQ(peer.reply(), id);
    }
    EXPECT_EQ(errors.size(), 0U); // the announced ones are still there
}

TEST_F(TransportPeersTest, PeerThatDoesNotReadHoldsItselfUpOnly) {
    answers = true;
    const struct {
        std::size_t size; // of an answer
        std::uint64_t count;
    } cases[] = {{64 << 10, 400}, {0, 10'000}};
    for (const auto& each : cases) {
        SCOPED_TRACE(each.size);
        standardAnswer = {{"answer", Value::data(std::string(each.size, 'x'))}};
        start();
        handled = 0;
        RawPeer peer = ready();
        std::jthread writer([&] {
            for (std::uint64_t id = 0; id < each.count; ++id) EXPECT_TRUE(peer.write(numbered(id, 100)));
        });
        expectService();
        expectService();
        // What the pause allows, one more turn, and what the socket's buffer holds.
        if (each.size > 0) {
            EXPECT_LE(handled, (pauseUnsentBytes + 2 * mebibyte) / each.size + framesPerTurn);
        }
        peer.expectReplies(0, each.count);
        EXPECT_EQ(handled, each.count + 2);
        transport = nullptr;
    }
}

TEST_F(TransportPeersTest, RepliesBeyondTheLimitsEndTheConnection) {
    start();
    RawPeer peer = ready(numbered(1));
    take().answer({{"answer", Value::data(std::string(maximumFrameLength, 'x'))}});
    EXPECT_TRUE(peer.isClosed());
    expectInvalid("too long");

    const Dictionary large{{"answer", Value::data(std::string(16 * mebibyte, 'x'))}};
    for (const bool isOneConnection : {true, false}) {
        SCOPED_TRACE(isOneConnection);
        if (!isOneConnection) limits.unsent.perUser = maximumUnsentBytes;
        start();
        constexpr std::size_t fitting = maximumUnsentBytes / (16 * mebibyte) - 1;
        std::vector<RawPeer> peers;
        for (std::uint64_t id = 0; id < fitting + 3; ++id) {
            if (id == 0 || !isOneConnection) peers.push_back(ready());
            peers.back().write(numbered(id));
        }
        const std::vector<Request> taken = takeSeveral(fitting + 3);
        for (std::size_t i = 0; i < fitting; ++i) taken[i].answer(large);
        expectService();
        EXPECT_EQ(errors.size(), 0U);
        for (std::size_t i = fitting; i < fitting + 3; ++i) taken[i].answer(large);
        expectInvalid("does not read");
        transport = nullptr;
    }
}

TEST_F(TransportPeersTest, HalfClosedPeerStillGetsItsReplies) {
    start();
    RawPeer peer = ready(numbered(1) + numbered(2));
    ::shutdown(peer.socket.get(), SHUT_WR);
    const std::vector<Request> taken = takeSeveral(2);
    const auto imminent = errors.take();
    ASSERT_TRUE(imminent);
    EXPECT_EQ(imminent->kind, TransportErrorKind::terminationImminent);
    for (const Request& each : taken) each.answer();
    peer.expectReplies(1, 3);
    EXPECT_EQ(errors.size(), 0U);
    peer.socket.reset();
    expectInvalid();
}

TEST_F(TransportPeersTest, RequestsOfAPeerThatIsGoneComeBeforeItsEnd) {
    start();
    constexpr std::uint64_t count = maximumWaitingRequests + 100; // its end is seen while reading is paused
    std::string bytes;
    for (std::uint64_t id = 0; id < count; ++id) bytes += numbered(id);
    ready(bytes);
    const std::vector<Request> taken = takeSeveral(maximumWaitingRequests);
    expectService();
    EXPECT_EQ(errors.size() + requests.size(), 0U); // the others still wait
    for (const Request& each : taken) each.answer();
    const std::vector<Request> late = takeSeveral(count - maximumWaitingRequests); // the end does not wait for them
    expectInvalid();
}

TEST_F(TransportPeersTest, ConnectionsOfOneUserAreBounded) {
    limits.connections.perUser = 20;
    start();
    std::vector<RawPeer> asking;
    for (int i = 0; i < 10; ++i) asking.push_back(ready(numbered(1)));
    const std::vector<Request> held = takeSeveral(asking.size());
    // Peers that say nothing count like others, and cost others nothing.
    std::vector<RawPeer> silent(20);
    for (RawPeer& peer : silent) ASSERT_TRUE(connect(peer));
    for (std::size_t i = 0; i < silent.size(); ++i) ASSERT_EQ(silent[i].greeting().has_value(), i < 10) << i;
    // Whose connection is gone has no place any more, though requests that came on it are still held.
    asking.clear();
    for (std::size_t i = 0; i < held.size(); ++i) expectInvalid();
    expectService();
}

TEST_F(TransportPeersTest, PeersAreTurnedAwayWithoutDescriptors) {
    if (support::checkerNeedsDescriptors) GTEST_SKIP() << "the checker needs descriptors itself";
    answers = true;
    start();
    RawPeer early = ready(numbered(1));
    EXPECT_EQ(early.reply(), 1U);
    RawPeer late;
    rlimit limit{};
    ::getrlimit(RLIMIT_NOFILE, &limit);
    const rlim_t lowestFree = static_cast<rlim_t>(Descriptor(::open("/dev/null", O_RDONLY | O_CLOEXEC)).get());
    const rlimit tight{lowestFree, limit.rlim_max};
    ::setrlimit(RLIMIT_NOFILE, &tight);
    EXPECT_TRUE(connect(late));
    EXPECT_TRUE(late.isClosed());
    early.write(numbered(2));
    EXPECT_EQ(early.reply(), 2U);
    ::setrlimit(RLIMIT_NOFILE, &limit);
    expectService();
}

TEST_F(TransportPeersTest, DescriptorsSentAlongAreNotKept) {
    start();
    answers = true;
    RawPeer peer = ready();
    int ends[2];
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    const Descriptor out(ends[0]);
    std::string bytes = numbered(1);
    iovec part{bytes.data(), bytes.size()};
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    *CMSG_FIRSTHDR(&message) = {CMSG_LEN(sizeof(int)), SOL_SOCKET, SCM_RIGHTS};
    std::memcpy(CMSG_DATA(CMSG_FIRSTHDR(&message)), &ends[1], sizeof(int));
    ASSERT_EQ(::sendmsg(peer.socket.get(), &message, 0), static_cast<ssize_t>(bytes.size()));
    ::close(ends[1]);
    EXPECT_EQ(peer.reply(), 1U);
    char none = 0;
    EXPECT_EQ(::read(out.get(), &none, 1), 0); // the last of the pipe's other end is gone
}

TEST_F(TransportPeersTest, NameIsHeldByOneProcessAndFreeWhenItIsGone) {
    // What a process that was killed leaves behind, at a path longer than a socket address.
    root += "/" + std::string(100, 'd') + "/" + std::string(100, 'e');
    std::filesystem::create_directories(pathOf(""));
    std::ofstream(pathOf(service) + ".lock");
    EXPECT_TRUE(callWithAddress(::bind, Descriptor(::socket(AF_UNIX, SOCK_STREAM, 0))));
    start();
    expectService();
    EXPECT_EQ(std::filesystem::status(pathOf(service)).permissions(), std::filesystem::perms(0666));

    const auto first = std::exchange(listener, nullptr);
    auto other = std::exchange(transport, nullptr);
    start(); // as another daemon does
    EXPECT_TRUE(listenerErrors.take());
    for (const std::string name : {"", ".", "..", "a/b", ".hidden", "a.lock"}) {
        EXPECT_TRUE(transport->createListener(name, queues->makeSerial("other"))->refusal()) << name;
    }
    transport = nullptr;
    expectService(); // the first has kept its socket
    other = nullptr;
    EXPECT_FALSE(std::filesystem::exists(pathOf(service)));
    start();
    expectService();
    EXPECT_EQ(listenerErrors.size(), 0U);
}

TEST_F(TransportPeersTest, SocketThatWasPassedInIsServed) {
    std::filesystem::create_directories(pathOf(""));
    const struct {
        const char* name;
        const char* file;
        const char* passedAs;
        bool isServed;
    } cases[] = {{"by its path", service, "unit.socket", true},
                 {"by its name", "elsewhere", service, true},
                 {"not ours", "elsewhere", "unit.socket", false}};
    for (const auto& each : cases) {
        SCOPED_TRACE(each.name);
        const Descriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        std::filesystem::remove(pathOf(each.file));
        ASSERT_TRUE(callWithAddress(::bind, socket, each.file));
        ::listen(socket.get(), 5);
        RawPeer early;
        ASSERT_TRUE(callWithAddress(::connect, early.socket, each.file));
        // Where a service manager passes it in.
        const Descriptor saved(::fcntl(3, F_DUPFD_CLOEXEC, 10));
        ::dup2(socket.get(), 3);
        ::setenv("LISTEN_PID", std::to_string(getpid()).c_str(), 1);
        ::setenv("LISTEN_FDS", "1", 1);
        ::setenv("LISTEN_FDNAMES", each.passedAs, 1);
        start();
        for (const char* variable : {"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES"}) ::unsetenv(variable);
        if (!saved || ::dup2(saved.get(), 3) < 0) ::close(3);
        if (each.isServed) {
            const auto greeting = early.greeting();
            ASSERT_TRUE(greeting);
            for (const char byte : RawPeer::answer(*greeting) + numbered(1)) early.write({&byte, 1});
            take().answer();
            EXPECT_EQ(early.reply(), 1U);
        } else {
            expectService(); // on a socket of its own
        }
        transport = nullptr;
        EXPECT_TRUE(std::filesystem::exists(pathOf(each.file))); // the manager's to remove
    }
}

TEST_F(TransportPeersTest, EachRequestHasOneOutcomeWhateverEndsWhen) {
    start();
    std::jthread answering[2];
    for (auto& thread : answering) {
        thread = std::jthread([&] {
            for (Request next = take(); next.connection; next = take()) {
                next.answer(*next.message.content.dictionary());
            }
        });
    }
    const auto clientQueue = queues->makeSerial("client");
    support::Mailbox<bool> outcomes; // true: as it should be
    for (unsigned round = 0; round < 40; ++round) {
        const auto client = transport->connect(service, clientQueue);
        client->resume();
        const bool isCancelled = round % 2 == 1;
        constexpr unsigned count = 20;
        auto ask = [&](unsigned first) {
            for (unsigned number = first; number < first + count; ++number) {
                const Dictionary message{{"n", number}};
                client->sendWithReply(message, clientQueue, [&, message](const ReplyOrError& reply) {
                    const auto* dictionary = std::get_if<Dictionary>(&reply);
                    outcomes.put(dictionary != nullptr ? *dictionary == message : isCancelled);
                });
                if (isCancelled && number == round / 2) client->cancel();
            }
        };
        {
            const std::jthread others[] = {std::jthread(ask, count), std::jthread(ask, 2 * count)};
            ask(0);
        }
        for (unsigned i = 0; i < 3 * count; ++i) EXPECT_EQ(outcomes.take(), true);
        client->cancel();
        clientQueue->sync([] {});
        EXPECT_EQ(outcomes.size(), 0U);
    }
    for (std::size_t i = 0; i < std::size(answering); ++i) requests.put({});
}

} // namespace
