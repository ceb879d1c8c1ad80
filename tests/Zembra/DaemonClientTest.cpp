#include "Zembra/ZBDaemonClient.h"
#include "tests/support/SystemLogFake.h"
#include "tests/support/TransportFake.h"
#include "tests/support/WorkQueueFake.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::logged;
using support::processLog;
using zembra::ZBDaemonClient;

/// A daemon that keeps what it is asked and answers `reply`.
struct DaemonClient : testing::Test {
    void listen(const std::string& service = "com.nordane.zembra.zbd") {
        transport.allowService(service);
        listener = transport.createListener(service, queues.makeSerial("daemon"));
        listener->setEventHandler([this](const Listener::Event& event) {
            daemonSide = std::get<std::shared_ptr<Connection>>(event);
            daemonSide->setEventHandler([this](const ConnectionEvent& received) {
                const auto* message = std::get_if<ReceivedMessage>(&received);
                hasClientGone = message == nullptr;
                if (hasClientGone) return;
                requests.push_back(message->content);
                ReplyMessage answer = createReply(*message);
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
    std::shared_ptr<Listener> listener;
    std::shared_ptr<Connection> daemonSide;
    std::vector<Value> requests;
    Dictionary reply;
    bool hasClientGone = false;
};

TEST_F(DaemonClient, EachOperationSendsItsRequest) {
    listen();
    const auto client = connect();
    const UUID one = UUID::random();
    const UUID two = UUID::random();
    const std::vector<std::string> paths = {"/B", "/A"};
    const Array pathArray{"/B", "/A"};
    const ZBDaemonClient::PlugIns plugIns = {{"/B", two}, {"/A", one}};
    const Dictionary rules{{"VKExtensionPointIdentifier", "org.example.point"}};
    const auto ignore = [](const ReplyOrError&) {};

    const std::pair<std::function<void()>, Dictionary> cases[] = {
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
        {[&] { client->findPlugInByPathURL(URL::file("/A b"), ignore); },
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
    for (const auto& [operation, expected] : cases) {
        requests.clear();
        operation();
        run();
        auto message = MutableDictionary::copyOf(expected);
        message.set("version", 3);
        EXPECT_EQ(requests, std::vector<Value>{message}) << Value(message).description();
    }
    EXPECT_TRUE(logged(LogLevel::standard, "findPlugInByUUID " + one.text()));
    EXPECT_TRUE(logged(LogLevel::standard, "findPlugInByPathURL file:///A%20b"));
}

TEST_F(DaemonClient, RepliesArriveOnItsQueueAndAreTraced) {
    listen("org.example.other");
    auto client = connect("org.example.other");
    EXPECT_EQ(queues.made.back().label, "zbd_client");
    std::vector<Failure> errors;
    processLog.clear();
    reply = {{"errorcode", 11U}, {"error", "no"}};
    client->bulkPlugins(0, [&](const ReplyOrError& received) {
        client->replyQueue()->assertCurrent();
        errors.push_back(ZBDaemonClient::errorInReply(received));
    });
    EXPECT_TRUE(errors.empty());
    run();
    EXPECT_EQ(errors, std::vector<Failure>{Error("Zembra", 11, "no")});
    EXPECT_TRUE(logged(LogLevel::debug, "request: " + requests.front().description(), "traffic"));
    EXPECT_TRUE(logged(LogLevel::debug, "reply: " + Value(reply).description(), "traffic"));

    client.reset();
    run();
    EXPECT_TRUE(hasClientGone);
    EXPECT_TRUE(processLog.messages("ops").empty()) << "its own end is no communications error";
}

TEST_F(DaemonClient, AnAbsentDaemonShowsInReplyAndLog) {
    transport.refuseConnections();
    Failure error;
    const auto client = connect();
    client->bulkPlugins(0, [&](const ReplyOrError& received) { error = ZBDaemonClient::errorInReply(received); });
    run();
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain, "Zembra");
    EXPECT_EQ(error->code, 4);
    EXPECT_TRUE(logged(LogLevel::error, "Communications error: " + *error->description));
}

TEST(ErrorInReply, FollowsCodeAndText) {
    const auto error = [](std::int64_t code, const char* text) { return Failure(Error{"Zembra", code, text}); };
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
    processLog.print();
    EXPECT_DEATH((void)ZBDaemonClient::errorInReply(Dictionary{{"error", "odd"}}),
                 "zbd reported error without a code: odd");
}

TEST_F(DaemonClient, MatchesTravelInVersion3Only) {
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
