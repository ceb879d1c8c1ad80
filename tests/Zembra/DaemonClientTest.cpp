#include "Zembra/ZBDaemonClient.h"
#include "tests/support/FakeDaemon.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::logged;
using support::processLog;
using zembra::ZBDaemonClient;

struct DaemonClient : testing::Test {
    support::FakeDaemon daemon;
    std::shared_ptr<ZBDaemonClient> client = connect();

    std::shared_ptr<ZBDaemonClient> connect() {
        return ZBDaemonClient::initWithServiceName(daemon.fake.transport, daemon.fake.queues, std::nullopt);
    }
};

TEST_F(DaemonClient, EachOperationSendsItsRequest) {
    const UUID one = UUID::random();
    const UUID two = UUID::random();
    const std::vector<std::string> paths = {"/B", "/A"};
    const ZBDaemonClient::PlugIns plugIns = {{"/B", two}, {"/A", one}};
    const Dictionary some{{"a", "b"}};
    const auto ignore = [](const ReplyOrError&) {};

    const std::string pairs = format("uuids = (%@, %@); paths = (/A, /B)", one, two);
    const std::tuple<std::function<void()>, std::string, std::string> cases[] = {
        {[&] { client->addPlugIns(paths, ignore); }, "add", "paths = (/B, /A)"},
        {[&] { client->removePlugIns(paths, ignore); }, "remove", "paths = (/B, /A)"},
        {[&] { client->bulkPlugins(5, ignore); }, "bulk", "flags = 5"},
        {[&] { client->readyPlugIns(plugIns, 1, some, ignore); }, "ready",
         "flags = 1; environment = {a = b}; " + pairs},
        {[&] { client->readyPlugIns({}, 0, {}, ignore); }, "ready", "flags = 0; uuids = (); paths = ()"},
        {[&] { client->accessPlugIns(plugIns, 2, ignore); }, "access", "flags = 2; " + pairs},
        {[&] { client->findPlugInByUUID(one, ignore); }, "find", "uuids = " + one.text()},
        {[&] { client->findPlugInByPathURL(URL::file("/A b"), ignore); }, "find", "paths = file:///A%20b"},
        {[&] { client->matchPlugIns(some, 0x200, ignore); }, "match", "rules = {a = b}; flags = 512"},
        {[&] { client->matchPlugIns({}, 0, ignore); }, "match", "flags = 0"},
        {[&] { client->setPluginAnnotations({two, one}, some, ignore); }, "annotate",
         format("uuids = (%@, %@); annotations = {a = b}", two, one)},
        {[&] { client->bulkSetPluginAnnotations(some, ignore); }, "bulk-annotate", "annotations = {a = b}"},
        {[&] { client->holdPlugins(paths, 7, ignore); }, "lock", "paths = (/B, /A); flags = 7"},
        {[&] { client->releaseHold(one, ignore); }, "lock", format("uuids = (%@)", one)}};
    for (const auto& [operation, type, rest] : cases) {
        operation();
        const std::string line = "request: {request = " + type + "; version = 3; " + rest + "}";
        EXPECT_TRUE(processLog.contains(LogLevel::debug, "traffic", line)) << line;
    }
    EXPECT_TRUE(logged(LogLevel::standard, "findPlugInByUUID " + one.text()));
    EXPECT_TRUE(logged(LogLevel::standard, "findPlugInByPathURL file:///A%20b"));
}

TEST_F(DaemonClient, RepliesArriveOnItsQueueAndAreTraced) {
    EXPECT_EQ(daemon.fake.queues.made.back().label, "zbd_client");
    Failure error;
    const auto callback = [&](const ReplyOrError& reply) {
        client->replyQueue()->assertCurrent();
        error = ZBDaemonClient::errorInReply(reply);
    };
    client->findPlugInByUUID(UUID::random(), callback);
    daemon.fake.transport.deliver();
    EXPECT_EQ(error, (Error{"Zembra", 15, "Cannot locate PlugIn"}));
    EXPECT_TRUE(logged(LogLevel::debug, "reply: {errorcode = 15; error = Cannot locate PlugIn}", "traffic"));
    client.reset();
    daemon.fake.transport.deliver();
    EXPECT_TRUE(logged(LogLevel::debug, "client 77 is dead"));
    EXPECT_FALSE(logged(LogLevel::error, "")) << "its own end is no communications error";

    daemon.fake.transport.refuseConnections();
    client = connect();
    client->bulkPlugins(0, callback);
    daemon.fake.transport.deliver();
    EXPECT_EQ(error->code, 4);
    EXPECT_TRUE(logged(LogLevel::error, "Communications error: " + *error->description));
}

TEST(ErrorInReplyDeathTest, FollowsCodeAndText) {
    EXPECT_FALSE(ZBDaemonClient::errorInReply(Dictionary{{"extensions", Array()}}));
    EXPECT_FALSE(ZBDaemonClient::errorInReply(Dictionary{{"errorcode", 0U}}));
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
    for (const std::uint64_t version : {0U, 2U, 4U}) {
        client->setProtocolVersion(static_cast<std::int64_t>(version));
        EXPECT_FALSE(client->convertFromQMX(encoded) || ZBDaemonClient::convertToQMX(forms, version)) << version;
    }
}

} // namespace
