#include "platform/linux/Transport.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/TransportFake.h"
#include "tests/support/TransportService.h"
#include "tests/support/WorkQueueFake.h"

#include <unistd.h>

namespace {

using namespace platform;
using support::Mailbox;

/// The same cases run on sockets and on the twin.
class TransportTest : public support::TransportService, public testing::WithParamInterface<bool> {
protected:
    TransportTest() {
        if (GetParam()) {
            queues = std::make_unique<linux_::WorkQueues>();
            transport = std::make_unique<linux_::Transport>(linux_::Root(scratch.path()));
        } else {
            auto fakeQueues = std::make_unique<support::FakeWorkQueues>();
            auto fake = std::make_unique<support::FakeTransport>();
            fake->allowService(service);
            fake->setPeer({getpid(), getuid(), getgid(), nullptr});
            pump = [transport = fake.get(), line = fakeQueues.get()] {
                while (transport->deliver() + line->runAll() > 0) {
                }
            };
            queues = std::move(fakeQueues);
            transport = std::move(fake);
        }
        clientQueue = queues->makeSerial("client");
    }
    ~TransportTest() override {
        settle();
        transport = nullptr; // before the mailboxes of this class
    }

    void settle() override {
        if (pump && transport) pump();
    }

    std::shared_ptr<Connection> connect() {
        auto connection = transport->connect(service, clientQueue);
        connection->setEventHandler(
            [this](const ConnectionEvent& event) { clientErrors.put(std::get<TransportError>(event)); });
        connection->resume();
        return connection;
    }
    void ask(const std::shared_ptr<Connection>& connection, const Dictionary& message = {}) {
        connection->sendWithReply(message, clientQueue, [this](const ReplyOrError& reply) { replies.put(reply); });
    }
    void expectReply(const Dictionary& content = {}) {
        const auto reply = next(replies);
        EXPECT_TRUE(reply && std::holds_alternative<Dictionary>(*reply) && std::get<Dictionary>(*reply) == content);
    }
    void expectErrorReply() {
        const auto reply = next(replies);
        ASSERT_TRUE(reply && std::holds_alternative<TransportError>(*reply));
        expectInvalid(std::get<TransportError>(*reply));
    }

    Mailbox<TransportError> clientErrors; // at the connecting ends
    Mailbox<ReplyOrError> replies;
    std::shared_ptr<WorkQueue> clientQueue;
    std::function<void()> pump;
};

TEST_P(TransportTest, MessagesAndRepliesArriveAsSent) {
    const auto listener = serve();
    const auto client = connect();
    const Dictionary message{{"text", "ä"},
                             {"id", UUID::random()},
                             {"bytes", Value::data(std::string_view("\0\xff", 2))},
                             {"when", Date{1.5}},
                             {"nested", Array{Dictionary{{"n", ~std::uint64_t{0}}}, 2.5, false}}};
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
    Mailbox<std::shared_ptr<Connection>> arrived;
    const auto listener = listen([&](const std::shared_ptr<Connection>& connection) { arrived.put(connection); });
    const auto client = connect();
    ask(client, {{"n", 1}});
    settle();
    EXPECT_EQ(arrived.size(), 0U);
    listener->resume();
    const auto connection = next(arrived);
    ASSERT_TRUE(connection);
    ask(client, {{"n", 2}});
    settle();
    EXPECT_EQ(requests.size(), 0U);
    serve(*connection);
    take({{"n", 1}});
    take({{"n", 2}});
}

TEST_P(TransportTest, UnkeptConnectionsAndUnknownServicesAreInvalid) {
    const auto listener = listen([](const auto&) {});
    listener->resume();
    for (const bool isServed : {true, false}) {
        if (!isServed) listener->cancel();
        const auto client = connect();
        ask(client);
        expectErrorReply();
        expectInvalid(next(clientErrors));
        ask(client); // it stays invalid
        expectErrorReply();
        EXPECT_EQ(clientErrors.size(), 0U);
    }
}

TEST_P(TransportTest, InvalidComesLastAndReleasesEverything) {
    auto context = std::make_shared<int>(7);
    const std::weak_ptr<int> contextAlive = context;
    auto captured = std::make_shared<int>(8);
    const std::weak_ptr<int> handlerAlive = captured;
    Mailbox<int> finalized;
    const auto listener = listen([&](const std::shared_ptr<Connection>& connection) {
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
    ask(client);
    {
        const Request request = take();
        client->cancel();
        expectErrorReply();
        expectInvalid(next(clientErrors));
        expectInvalid();
        EXPECT_EQ(next(finalized), 7);
        request.answer(); // to a gone connection: goes nowhere
    }
    // The finalizer comes before the last references go, so these are waited for with a round trip.
    context = std::make_shared<int>(9);
    captured = std::make_shared<int>(9);
    const auto later = connect();
    ask(later);
    const Request request = take();
    EXPECT_TRUE(contextAlive.expired());
    EXPECT_TRUE(handlerAlive.expired());
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

TEST_P(TransportTest, CancelInsideTheHandlerEndsBothEnds) {
    const auto listener = listen([this](const std::shared_ptr<Connection>& connection) {
        connection->setEventHandler([this, weak = std::weak_ptr(connection)](const ConnectionEvent& event) {
            const auto strong = weak.lock();
            if (strong && std::holds_alternative<ReceivedMessage>(event)) strong->cancel();
            put(nullptr, event);
        });
        connection->resume();
    });
    listener->resume();
    const auto client = connect();
    ask(client);
    ask(client);
    expectErrorReply();
    expectErrorReply();
    expectInvalid();
    EXPECT_EQ(requests.size(), 1U); // nothing is delivered after the cancel
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
    const auto error = next(listenerErrors);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->kind, TransportErrorKind::other);
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

} // namespace
