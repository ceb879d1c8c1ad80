#include "Zembra/ZBDaemonClient.h"
#include "tests/support/FakeDaemon.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using namespace std::string_literals;
using support::logged;
using support::processLog;
using zembra::ZBDaemonClient;

struct DaemonClient : testing::Test {
    support::FakeDaemon daemon;
    support::FakePlatform& fake = daemon.fake;
    std::shared_ptr<ZBDaemonClient> client = ZBDaemonClient::initWithServiceName(fake.transport, fake.queues, {});
};

TEST_F(DaemonClient, ListsTravelInTheirOrderAndPlugInsWithTheirPaths) {
    const UUID one = UUID::random();
    const UUID two = UUID::random();
    const ZBDaemonClient::PlugIns plugIns = {{"/B", two}, {"/A", one}};
    const Dictionary some{{"a", "b"}};
    const auto ignore = [](const ReplyOrError&) {};
    client->readyPlugIns(plugIns, 1, some, ignore);
    client->accessPlugIns(plugIns, 2, ignore);
    client->matchPlugIns({}, 0, ignore);
    client->setPluginAnnotations({two, one}, some, ignore);
    client->holdPlugins({"/B", "/A"}, 7, ignore);
    client->releaseHold(one, ignore);
    const std::string pairs = format("uuids = (%@, %@); paths = (/A, /B)", one, two);
    for (const auto& request :
         {"ready; version = 3; flags = 1; environment = {a = b}; " + pairs, "access; version = 3; flags = 2; " + pairs,
          "match; version = 3; flags = 0"s,
          format("annotate; version = 3; uuids = (%@, %@); annotations = {a = b}", two, one),
          "lock; version = 3; paths = (/B, /A); flags = 7"s, format("lock; version = 3; uuids = (%@)", one)})
        EXPECT_TRUE(logged(LogLevel::debug, "request: {request = " + request + "}", "traffic")) << request;
}

TEST_F(DaemonClient, RepliesArriveOnItsQueueAndAreTraced) {
    Failure error;
    const auto callback = [&](const ReplyOrError& reply) {
        client->replyQueue()->assertCurrent();
        error = ZBDaemonClient::errorInReply(reply);
    };
    client->findPlugInByUUID(UUID::random(), callback);
    fake.transport.deliver();
    EXPECT_EQ(error, (Error{"Zembra", 15, "Cannot locate PlugIn"}));
    EXPECT_TRUE(logged(LogLevel::standard, "findPlugInByUUID "));
    EXPECT_TRUE(logged(LogLevel::debug, "reply: {errorcode = 15; error = Cannot locate PlugIn}", "traffic"));
    client.reset();
    fake.transport.deliver();
    EXPECT_FALSE(logged(LogLevel::error, "")) << "its own end is no communications error";

    fake.transport.refuseConnections();
    client = ZBDaemonClient::initWithServiceName(fake.transport, fake.queues, {});
    client->bulkPlugins(0, callback);
    fake.transport.deliver();
    EXPECT_EQ(error->code, 4);
    EXPECT_TRUE(logged(LogLevel::error, "Communications error: " + *error->description));
}

TEST(ErrorInReplyDeathTest, FollowsCodeAndText) {
    EXPECT_EQ(ZBDaemonClient::errorInReply(Dictionary{{"errorcode", 9U}, {"error", 5}}),
              (Error{"Zembra", 9, "unknown error returned by Zembra subsystem"}));
    processLog.print();
    EXPECT_DEATH((void)ZBDaemonClient::errorInReply(Dictionary{{"error", "odd"}}),
                 "zbd reported error without a code: odd");
}

TEST_F(DaemonClient, MatchesTravelInVersion3Only) {
    const Value forms = Array{Dictionary{{"identifier", "org.example.share"}, {"lastmodified", -1}}};
    const Value encoded = *ZBDaemonClient::convertToQMX(forms, 3);
    EXPECT_EQ(client->convertFromQMX(encoded), forms);
    for (const Value& odd : {Value::data("\xFF garbage"), forms, Value()}) EXPECT_FALSE(client->convertFromQMX(odd));
    client->setProtocolVersion(2);
    EXPECT_FALSE(client->convertFromQMX(encoded) || ZBDaemonClient::convertToQMX(forms, 4));
}

} // namespace
