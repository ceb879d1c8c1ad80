#include "platform/linux/Transport.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/Mailbox.h"
#include "tests/support/ScratchDirectory.h"
#include "tests/support/TransportFake.h"

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

using namespace platform;
using support::Mailbox;

constexpr const char* service = "com.example.service";

/// The same cases run on sockets and on the twin.
class TransportTest : public testing::TestWithParam<bool> {
protected:
    TransportTest() {
        if (GetParam()) {
            transport = std::make_unique<linux_::Transport>(linux_::Root(scratch.path()));
        } else {
            auto fake = std::make_unique<support::FakeTransport>(support::FakeTransport::Mode::inPlace);
            fake->allowService(service);
            fake->setPeer({getpid(), getuid(), getgid(), nullptr});
            transport = std::move(fake);
        }
    }

    /// Listens and gives each new connection to `accept`.
    std::shared_ptr<Listener> listen(std::function<void(const std::shared_ptr<Connection>&)> accept) {
        auto listener = transport->createListener(service, queues.makeSerial("qmx", QualityOfService::standard));
        listener->setEventHandler([accept = std::move(accept)](const Listener::Event& event) {
            if (const auto* connection = std::get_if<std::shared_ptr<Connection>>(&event)) accept(*connection);
        });
        return listener;
    }

    /// Listens; requests and errors of all connections go to `requests` and `errors`.
    std::shared_ptr<Listener> collect() {
        auto listener = listen([this](const std::shared_ptr<Connection>& connection) { collectFrom(connection); });
        listener->resume();
        return listener;
    }
    void collectFrom(const std::shared_ptr<Connection>& connection) {
        connection->setEventHandler(
            [this, weak = std::weak_ptr(connection)](const ConnectionEvent& event) { put(weak.lock(), event); });
        connection->resume();
    }
    void put(const std::shared_ptr<Connection>& connection, const ConnectionEvent& event) {
        if (const auto* message = std::get_if<ReceivedMessage>(&event)) {
            requests.put({connection, *message});
        } else {
            errors.put(std::get<TransportError>(event));
        }
    }

    std::shared_ptr<Connection> connect() {
        auto connection = transport->connect(service, clientQueue);
        connection->setEventHandler([this](const ConnectionEvent& event) {
            if (const auto* error = std::get_if<TransportError>(&event)) clientErrors.put(*error);
        });
        connection->resume();
        return connection;
    }
    void ask(const std::shared_ptr<Connection>& connection, const Dictionary& message) {
        connection->sendWithReply(message, clientQueue, [this](const ReplyOrError& reply) { replies.put(reply); });
    }

    struct Request {
        std::shared_ptr<Connection> connection;
        ReceivedMessage message;

        void answer(const Dictionary& content) const {
            ReplyMessage reply = createReply(message);
            reply.content.merge(content);
            connection->send(reply);
        }
    };

    void expectError(std::optional<ReplyOrError> reply) {
        ASSERT_TRUE(reply);
        const auto* error = std::get_if<TransportError>(&*reply);
        ASSERT_NE(error, nullptr);
        EXPECT_EQ(error->kind, TransportErrorKind::connectionInvalid);
        EXPECT_FALSE(error->description.empty());
    }
    void expectReply(std::optional<ReplyOrError> reply, const Dictionary& content) {
        ASSERT_TRUE(reply);
        const auto* dictionary = std::get_if<Dictionary>(&*reply);
        ASSERT_NE(dictionary, nullptr) << std::get<TransportError>(*reply).description;
        EXPECT_EQ(*dictionary, content);
    }
    void expectInvalid(std::optional<TransportError> error) {
        ASSERT_TRUE(error);
        EXPECT_EQ(error->kind, TransportErrorKind::connectionInvalid);
    }

    support::ScratchDirectory scratch;
    Mailbox<Request> requests;
    Mailbox<TransportError> errors;       // at accepted connections
    Mailbox<TransportError> clientErrors; // at the connecting ends
    Mailbox<ReplyOrError> replies;
    linux_::WorkQueues queues;
    std::shared_ptr<WorkQueue> clientQueue = queues.makeSerial("client", QualityOfService::standard);
    std::unique_ptr<Transport> transport; // goes first: nothing is delivered afterwards
};

TEST_P(TransportTest, MessagesAndRepliesArriveAsSent) {
    const auto listener = collect();
    const auto client = connect();
    const Dictionary message{{"text", "ä"},
                             {"id", UUID::random()},
                             {"bytes", Value::data(std::string_view("\0\xff", 2))},
                             {"when", Date{1.5}},
                             {"nested", Array{Dictionary{{"n", ~std::uint64_t{0}}}, 2.5, false}}};
    ask(client, message);
    const auto request = requests.take();
    ASSERT_TRUE(request);
    EXPECT_EQ(request->message.content, Value(message));
    EXPECT_EQ(request->connection->peerPid(), getpid());
    EXPECT_EQ(request->connection->peerAuditToken().uid, getuid());
    request->answer(message);
    expectReply(replies.take(), message);

    // A second reply goes nowhere, and neither does one through a connection that the request did not come on.
    request->answer({{"second", true}});
    const auto other = connect();
    ask(other, {{"n", 2}});
    const auto next = requests.take();
    ASSERT_TRUE(next);
    Request{request->connection, next->message}.answer({{"astray", true}});
    next->answer({{"n", 2}});
    expectReply(replies.take(), Dictionary{{"n", 2}});
}

TEST_P(TransportTest, NothingIsDeliveredBeforeResume) {
    std::shared_ptr<Connection> accepted;
    Mailbox<bool> arrivals;
    const auto listener = listen([&](const std::shared_ptr<Connection>& connection) {
        accepted = connection;
        arrivals.put(true);
    });
    const auto client = connect();
    ask(client, {{"n", 1}});
    EXPECT_EQ(arrivals.size(), 0U);
    listener->resume();
    ASSERT_TRUE(arrivals.take());
    ask(client, {{"n", 2}});
    EXPECT_EQ(requests.size(), 0U);
    collectFrom(accepted);
    for (const int n : {1, 2}) {
        const auto request = requests.take();
        ASSERT_TRUE(request);
        EXPECT_EQ(request->message.content, Value(Dictionary{{"n", n}}));
    }
}

TEST_P(TransportTest, ConnectionThatNobodyKeepsIsClosed) {
    const auto listener = listen([](const auto&) {});
    listener->resume();
    const auto client = connect();
    ask(client, {});
    expectError(replies.take());
    expectInvalid(clientErrors.take());
    ask(client, {}); // it stays invalid
    expectError(replies.take());
}

TEST_P(TransportTest, NoServiceIsAnErrorInPlaceOfReplies) {
    const auto client = connect();
    ask(client, {});
    expectError(replies.take());
    expectInvalid(clientErrors.take());
    EXPECT_EQ(clientErrors.size(), 0U);
}

TEST_P(TransportTest, InvalidComesLastAndReleasesEverything) {
    auto context = std::make_shared<int>(7);
    const std::weak_ptr<int> contextAlive = context;
    auto captured = std::make_shared<int>(8);
    const std::weak_ptr<int> handlerAlive = captured;
    Mailbox<int> finalized;
    std::weak_ptr<Connection> accepted;
    const auto listener = listen([&](const std::shared_ptr<Connection>& connection) {
        accepted = connection;
        connection->setContext(std::exchange(context, nullptr), [&](const std::shared_ptr<void>& kept) {
            finalized.put(*static_cast<int*>(kept.get()));
        });
        // The handler keeps its own connection, as a client object of a server does.
        connection->setEventHandler([this, connection, kept = std::exchange(captured, nullptr)](
                                        const ConnectionEvent& event) { put(connection, event); });
        connection->resume();
    });
    listener->resume();
    const auto client = connect();
    ask(client, {});
    auto request = requests.take();
    ASSERT_TRUE(request);
    client->cancel();
    expectError(replies.take());
    expectInvalid(clientErrors.take());
    expectInvalid(errors.take());
    EXPECT_EQ(finalized.take(), 7);
    request->answer({}); // to a gone connection: goes nowhere
    request.reset();
    // The finalizer comes before the last references go, so these are waited for with a round trip.
    context = std::make_shared<int>(9);
    captured = std::make_shared<int>(9);
    const auto next = connect();
    ask(next, {});
    ASSERT_TRUE(requests.take());
    EXPECT_TRUE(contextAlive.expired());
    EXPECT_TRUE(handlerAlive.expired());
    EXPECT_EQ(errors.size() + finalized.size(), 0U);
    transport.reset(); // while the mailbox for the second finalizer is there
    EXPECT_EQ(finalized.take(), 9);
}

TEST_P(TransportTest, CancelInsideTheHandlerEndsBothEnds) {
    const auto listener = listen([this](const std::shared_ptr<Connection>& connection) {
        connection->setEventHandler([this, weak = std::weak_ptr(connection)](const ConnectionEvent& event) {
            if (const auto strong = weak.lock(); strong && std::holds_alternative<ReceivedMessage>(event))
                strong->cancel();
            put(nullptr, event);
        });
        connection->resume();
    });
    listener->resume();
    const auto client = connect();
    ask(client, {{"n", 1}});
    ask(client, {{"n", 2}});
    expectError(replies.take());
    expectError(replies.take());
    expectInvalid(errors.take());
    EXPECT_EQ(requests.size(), 1U); // nothing is delivered after the cancel
}

TEST_P(TransportTest, TakenNameIsReportedAfterResumeAndFreeAfterCancel) {
    const auto listener = collect();
    const auto client = connect();
    ask(client, {});
    auto request = requests.take();
    ASSERT_TRUE(request);

    Mailbox<Listener::Event> events;
    const auto second = transport->createListener(service, clientQueue);
    second->setEventHandler([&](const Listener::Event& event) { events.put(event); });
    EXPECT_EQ(events.size(), 0U);
    second->resume();
    const auto event = events.take();
    ASSERT_TRUE(event);
    const auto* error = std::get_if<TransportError>(&*event);
    ASSERT_NE(error, nullptr);
    EXPECT_EQ(error->kind, TransportErrorKind::other);
    second->cancel();

    listener->cancel();
    // Accepted connections are not touched, and their requests come after the cancel has taken effect.
    request->answer({{"n", 1}});
    expectReply(replies.take(), Dictionary{{"n", 1}});
    ask(client, {});
    request = requests.take();
    ASSERT_TRUE(request);
    ask(connect(), {});
    expectError(replies.take());
    const auto third = collect();
    ask(connect(), {});
    request = requests.take();
    ASSERT_TRUE(request);
    request->answer({});
    expectReply(replies.take(), Dictionary());
}

TEST_P(TransportTest, RepliesFromSeveralThreadsReachTheirRequests) {
    const auto listener = collect();
    const auto client = connect();
    constexpr int perThread = 50;
    std::vector<std::jthread> threads;
    for (int thread = 0; thread < 4; ++thread) {
        threads.emplace_back([&, thread] {
            for (int i = 0; i < perThread; ++i) {
                const int number = thread * perThread + i;
                client->sendWithReply({{"n", number}}, clientQueue, [this, number](const ReplyOrError& reply) {
                    const auto* content = std::get_if<Dictionary>(&reply);
                    replies.put(Dictionary{{"right", content != nullptr && *content == Dictionary{{"n", number}}}});
                });
            }
        });
        threads.emplace_back([&] {
            for (int i = 0; i < perThread; ++i) {
                const auto request = requests.take();
                if (request) request->answer(*request->message.content.dictionary());
            }
        });
    }
    for (int i = 0; i < 4 * perThread; ++i) expectReply(replies.take(), Dictionary{{"right", true}});
}

TEST_P(TransportTest, NothingIsCalledAfterDestruction) {
    auto listener = collect();
    const auto client = connect();
    ask(client, {});
    const auto request = requests.take();
    ASSERT_TRUE(request);
    transport.reset();
    request->answer({});
    client->cancel();
    listener->cancel();
    clientQueue->sync([] {});
    EXPECT_EQ(replies.size() + errors.size() + clientErrors.size(), 0U);
}

INSTANTIATE_TEST_SUITE_P(Transports, TransportTest, testing::Bool(),
                         [](const auto& each) { return each.param ? "Linux" : "Fake"; });

} // namespace
