#include "Zembra/ZBDaemonClient.h"
#include "tests/support/SystemLogFake.h"
#include "tests/support/TransportFake.h"
#include "tests/support/WorkQueueFake.h"

#include <gtest/gtest.h>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::Failure;
using platform::ReplyOrError;
using platform::UUID;
using platform::Value;
using support::processLog;
using zembra::ZBDaemonClient;

/// A daemon that keeps what it is asked and answers `reply`.
class DaemonClientTest : public testing::Test {
protected:
    void listen(const std::string& service) {
        transport.allowService(service);
        listener = transport.createListener(service, queues.makeSerial("daemon"));
        listener->setEventHandler([this](const platform::Listener::Event& event) {
            daemonSide = std::get<std::shared_ptr<platform::Connection>>(event);
            daemonSide->setEventHandler([this](const platform::ConnectionEvent& received) {
                const auto* message = std::get_if<platform::ReceivedMessage>(&received);
                if (!message) {
                    hasClientGone = true;
                    return;
                }
                requests.push_back(message->content);
                platform::ReplyMessage answer = platform::createReply(*message);
                answer.content.merge(reply);
                daemonSide->send(answer);
            });
            daemonSide->resume();
        });
        listener->resume();
    }
    std::shared_ptr<ZBDaemonClient> connect(const std::optional<std::string>& name = std::nullopt) {
        return ZBDaemonClient::initWithServiceName(transport, queues, name);
    }
    void run() {
        while (transport.deliver() + queues.runAll() > 0) {
        }
    }

    support::FakeWorkQueues queues;
    support::FakeTransport transport;
    std::shared_ptr<platform::Listener> listener;
    std::shared_ptr<platform::Connection> daemonSide;
    std::vector<Value> requests;
    Dictionary reply;
    bool hasClientGone = false;
};

TEST_F(DaemonClientTest, ConnectsToTheNamedService) {
    const std::vector<std::pair<std::optional<std::string>, std::string>> cases = {
        {std::nullopt, "com.nordane.zembra.zbd"}, {"org.example.other", "org.example.other"}};
    for (const auto& [name, service] : cases) {
        listen(service);
        requests.clear();
        const auto client = connect(name);
        EXPECT_EQ(queues.made.back().label, "zbd_client");
        client->bulkPlugins(0, [](const ReplyOrError&) {});
        run();
        EXPECT_EQ(requests.size(), 1U) << service;
    }
}

TEST_F(DaemonClientTest, EachOperationSendsItsRequest) {
    listen("com.nordane.zembra.zbd");
    const auto client = connect();
    const UUID one = UUID::random();
    const UUID two = UUID::random();
    const std::vector<std::string> paths = {"/B", "/A"};
    const Array pathArray{"/B", "/A"};
    const ZBDaemonClient::PlugIns plugIns = {{"/B", two}, {"/A", one}};
    const Dictionary rules{{"VKExtensionPointIdentifier", "org.example.point"}};
    const auto ignore = [](const ReplyOrError&) {};

    struct Case {
        std::function<void()> operation;
        Dictionary expected; // besides the version
    };
    const std::vector<Case> cases = {
        {[&] { client->addPlugIns(paths, ignore); }, {{"request", "add"}, {"paths", pathArray}}},
        {[&] { client->removePlugIns(paths, ignore); }, {{"request", "remove"}, {"paths", pathArray}}},
        {[&] { client->bulkPlugins(5, ignore); }, {{"request", "bulk"}, {"flags", 5}}},
        {[&] { client->readyPlugIns(plugIns, 1, Dictionary{{"NAME", "value"}}, ignore); },
         {{"request", "ready"},
          {"flags", 1},
          {"environment", Dictionary{{"NAME", "value"}}},
          {"uuids", Array{one, two}},
          {"paths", Array{"/A", "/B"}}}},
        {[&] { client->readyPlugIns({}, 0, std::nullopt, ignore); },
         {{"request", "ready"}, {"flags", 0}, {"uuids", Array()}, {"paths", Array()}}},
        {[&] { client->accessPlugIns(plugIns, 2, ignore); },
         {{"request", "access"}, {"flags", 2}, {"uuids", Array{one, two}}, {"paths", Array{"/A", "/B"}}}},
        {[&] { client->findPlugInByUUID(one, ignore); }, {{"request", "find"}, {"uuids", one}}},
        {[&] { client->findPlugInByPathURL(platform::URL::file("/A b"), ignore); },
         {{"request", "find"}, {"paths", "file:///A%20b"}}},
        {[&] { client->matchPlugIns(rules, 0x200, ignore); },
         {{"request", "match"}, {"rules", rules}, {"flags", 0x200}}},
        {[&] { client->matchPlugIns(std::nullopt, 0, ignore); }, {{"request", "match"}, {"flags", 0}}},
        {[&] { client->setPluginAnnotations({two, one}, {{"election", 1}}, ignore); },
         {{"request", "annotate"}, {"uuids", Array{two, one}}, {"annotations", Dictionary{{"election", 1}}}}},
        {[&] { client->bulkSetPluginAnnotations({{one.text(), Dictionary()}}, ignore); },
         {{"request", "bulk-annotate"}, {"annotations", Dictionary{{one.text(), Dictionary()}}}}},
        {[&] { client->holdPlugins(paths, 7, ignore); }, {{"request", "lock"}, {"paths", pathArray}, {"flags", 7}}},
        {[&] { client->releaseHold(one, ignore); }, {{"request", "lock"}, {"uuids", Array{one}}}},
    };
    for (const Case& each : cases) {
        requests.clear();
        each.operation();
        run();
        auto expected = platform::MutableDictionary::copyOf(each.expected);
        expected.set("version", 3);
        ASSERT_EQ(requests.size(), 1U);
        EXPECT_EQ(requests.front(), Value(expected)) << requests.front().description();
    }
    EXPECT_TRUE(processLog.contains(platform::LogLevel::standard, "ops", "findPlugInByUUID " + one.text()));
    EXPECT_TRUE(processLog.contains(platform::LogLevel::standard, "ops", "findPlugInByPathURL file:///A%20b"));
}

TEST_F(DaemonClientTest, RepliesArriveOnItsQueueAndAreTraced) {
    listen("com.nordane.zembra.zbd");
    const auto client = connect();
    std::vector<Failure> errors;
    const auto note = [&](const ReplyOrError& received) {
        client->replyQueue()->assertCurrent();
        errors.push_back(ZBDaemonClient::errorInReply(received));
    };
    processLog.clear();
    reply = {{"errorcode", 11U}, {"error", "no"}};
    client->bulkPlugins(0, note);
    EXPECT_TRUE(errors.empty());
    run();
    EXPECT_EQ(errors, std::vector<Failure>{platform::Error("Zembra", 11, "no")});
    EXPECT_EQ(processLog.messages("traffic"), (std::vector<std::string>{"request: " + requests.front().description(),
                                                                        "reply: " + Value(reply).description()}));
    EXPECT_EQ(processLog.lines().front().level, platform::LogLevel::debug);
}

TEST_F(DaemonClientTest, AnAbsentDaemonShowsInReplyAndLog) {
    transport.refuseConnections();
    const auto client = connect();
    Failure error;
    processLog.clear();
    client->bulkPlugins(0, [&](const ReplyOrError& received) { error = ZBDaemonClient::errorInReply(received); });
    run();
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain, "Zembra");
    EXPECT_EQ(error->code, 4);
    EXPECT_EQ(processLog.messages("traffic").back(), "reply: " + *error->description);
    EXPECT_TRUE(processLog.contains(platform::LogLevel::error, "ops", "Communications error: " + *error->description));
}

TEST_F(DaemonClientTest, ItsOwnEndIsNoCommunicationsError) {
    listen("com.nordane.zembra.zbd");
    auto client = connect();
    client->bulkPlugins(0, [](const ReplyOrError&) {});
    run();
    processLog.clear();
    client.reset();
    run();
    EXPECT_TRUE(hasClientGone);
    EXPECT_TRUE(processLog.messages("ops").empty());
}

TEST(ErrorInReply, FollowsCodeAndText) {
    const auto error = [](std::int64_t code, const char* text) {
        return Failure(platform::Error{"Zembra", code, text});
    };
    const std::vector<std::pair<Dictionary, Failure>> cases = {
        {{}, std::nullopt},
        {{{"extensions", Array()}}, std::nullopt},
        {{{"errorcode", 0U}}, std::nullopt},
        {{{"errorcode", 14U}, {"error", "plug-ins are busy"}, {"conflicts", Array()}}, error(14, "plug-ins are busy")},
        {{{"errorcode", 9U}}, error(9, "unknown error returned by Zembra subsystem")},
        {{{"errorcode", 9U}, {"error", 5}}, error(9, "unknown error returned by Zembra subsystem")},
    };
    for (const auto& [reply, expected] : cases) {
        EXPECT_EQ(ZBDaemonClient::errorInReply(reply), expected) << Value(reply).description();
    }
}

TEST(ErrorInReplyDeathTest, ATextWithoutACodeStopsTheProcess) {
    support::processLog.print();
    EXPECT_DEATH((void)ZBDaemonClient::errorInReply(Dictionary{{"error", "odd"}}),
                 "zbd reported error without a code: odd");
}

TEST_F(DaemonClientTest, MatchesTravelInVersion3Only) {
    const auto client = connect();
    const Value forms = Array{Dictionary{{"identifier", "org.example.share"}, {"lastmodified", -1}}};
    const auto encoded = ZBDaemonClient::convertToQMX(forms, 3);
    ASSERT_TRUE(encoded);
    EXPECT_EQ(client->convertFromQMX(*encoded), forms);
    EXPECT_FALSE(client->convertFromQMX(Value::data("\xFF garbage")));
    EXPECT_FALSE(client->convertFromQMX(forms)); // not an encoded list
    EXPECT_FALSE(client->convertFromQMX(Value()));
    for (const std::uint64_t version : {0U, 2U, 4U}) {
        EXPECT_EQ(ZBDaemonClient::convertToQMX(forms, version), std::nullopt) << version;
        client->setProtocolVersion(static_cast<std::int64_t>(version));
        EXPECT_FALSE(client->convertFromQMX(*encoded)) << version;
    }
}

} // namespace
