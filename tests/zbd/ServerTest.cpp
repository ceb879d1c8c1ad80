#include "tests/support/FakeDaemon.h"
#include "zbd/ZBDQmxClient.h"

#include <gtest/gtest.h>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::LogLevel;
using platform::TransportError;
using platform::TransportErrorKind;
using platform::UUID;
using platform::Value;
using support::processLog;
using zbd::ZBDPlugInHold;

constexpr const char* change = "com.nordane.zembra.annotation-change";

struct Server : testing::Test {
    support::FakeDaemon daemon;

    zbd::ZBDPlugInRef plugIn(const std::string& name) {
        return daemon.server->findPlugIn(*daemon.fake.registry.install(support::dataPlugIn(name))->uuid);
    }
    std::shared_ptr<ZBDPlugInHold> hold(const std::vector<zbd::ZBDPlugInRef>& plugIns,
                                        const std::shared_ptr<zbd::ZBDQmxClient>& client = nullptr) {
        auto made = ZBDPlugInHold::initWithPlugIns(daemon.fake.transport, plugIns, client);
        daemon.server->addHold(made);
        return made;
    }
    std::size_t posts() { return daemon.fake.notifications.posts().size(); }
    static std::vector<std::string> releases() {
        std::vector<std::string> lines;
        for (const auto& line : processLog.lines()) {
            if (line.level == LogLevel::debug && line.message.starts_with("releasing plug-in hold ")) {
                lines.push_back(line.message);
            }
        }
        return lines;
    }
};

TEST_F(Server, ConstructionMakesTheQueuesAndTheSingleton) {
    std::vector<std::pair<std::string, platform::QualityOfService>> made;
    for (const auto& queue : daemon.fake.queues.made) made.emplace_back(queue.label, queue.quality);
    using enum platform::QualityOfService;
    for (const auto& expected : {std::pair{"qmx", standard}, {"service", userInitiated}, {"serverSync", standard}}) {
        EXPECT_TRUE(std::find(made.begin(), made.end(), std::pair<std::string, platform::QualityOfService>(expected)) !=
                    made.end())
            << expected.first;
    }
    EXPECT_EQ(zbd::ZBDServer::server(), daemon.server);
    EXPECT_EQ(daemon.server->delegate(), daemon.server);
    EXPECT_EQ(daemon.server->cacheLimit(), 1'000'000U);
    EXPECT_EQ(daemon.server->verbose(), 0U);
}

TEST_F(Server, ConnectionBeforeRunIsServedAfterIt) {
    support::FakeDaemon fresh;
    fresh.fake.transport.allowService("other");
    const auto server = zbd::ZBDServer::initForService(fresh.fake.platform, "other", std::nullopt);
    const auto connection = fresh.fake.transport.connect("other", fresh.fake.queues.makeSerial("host"));
    connection->setEventHandler([](const platform::ConnectionEvent&) {});
    connection->resume();
    const Dictionary bulk{{"request", "bulk"}, {"version", 3}};
    std::optional<Dictionary> answer;
    connection->sendWithReply(bulk, fresh.fake.queues.makeSerial("replies"),
                              [&](const platform::ReplyOrError& reply) { answer = std::get<Dictionary>(reply); });
    fresh.fake.transport.deliver();
    EXPECT_FALSE(answer);
    server->run();
    fresh.fake.transport.deliver();
    EXPECT_EQ(answer, Dictionary());
    EXPECT_EQ(fresh.fake.runLoop.runs, 1);
}

TEST_F(Server, ListenerErrorsAreLoggedAndIgnored) {
    auto& transport = daemon.fake.transport;
    transport.inject(daemon.server->service(), TransportError{TransportErrorKind::connectionInvalid, "gone"});
    transport.inject(daemon.server->service(), TransportError{TransportErrorKind::other, "odd"});
    transport.inject(daemon.server->service(), Value("what"));
    transport.deliver();
    EXPECT_TRUE(processLog.contains(LogLevel::standard, "ops", "potentially unexpected error from qmx: gone"));
    EXPECT_TRUE(processLog.contains(LogLevel::error, "ops", "unexpected error from qmx: odd"));
    EXPECT_TRUE(processLog.contains(LogLevel::error, "ops", "unexpected message: what"));
}

TEST_F(Server, HoldsBlockUntilTheirTokenReleasesThem) {
    const auto a = plugIn("a");
    const auto b = plugIn("b");
    const auto first = hold({a, a});
    const auto second = hold({a, b});
    EXPECT_EQ(first->blocked().size(), 1U);
    EXPECT_EQ(daemon.fake.transport.activityCount(), 2U);
    EXPECT_EQ(posts(), 2U);
    daemon.server->unholdToken(UUID::random());
    EXPECT_EQ(posts(), 2U);
    EXPECT_TRUE(releases().empty());

    daemon.server->unholdToken(first->uuid());
    EXPECT_TRUE(daemon.server->holdOnPlugIn(a)) << "the other hold stands";
    daemon.server->unholdToken(second->uuid());
    EXPECT_FALSE(daemon.server->holdOnPlugIn(a));
    EXPECT_FALSE(daemon.server->holdOnPlugIn(b));
    EXPECT_EQ(posts(), 4U);
    EXPECT_EQ(releases().front(), "releasing plug-in hold " + first->uuid().text() + " at client's request");
}

TEST_F(Server, HoldEndsItsKeepAliveActivity) {
    hold({plugIn("a")});
    EXPECT_EQ(daemon.fake.transport.activityCount(), 1U);
    daemon.server->unholdToken(daemon.server->holds().front()->uuid());
    EXPECT_EQ(daemon.fake.transport.activityCount(), 0U);
}

TEST_F(Server, StopReleasesTheHoldsInOrderAndNotifiesOnce) {
    const auto first = hold({plugIn("a")});
    const auto second = hold({});
    const auto before = posts();
    daemon.server->stop();
    EXPECT_EQ(releases(), (std::vector<std::string>{
                              "releasing plug-in hold " + first->uuid().text() + " because server is stopping",
                              "releasing plug-in hold " + second->uuid().text() + " because server is stopping"}));
    EXPECT_TRUE(daemon.server->holds().empty());
    EXPECT_EQ(posts(), before + 1);
    daemon.server->stop();
    EXPECT_EQ(posts(), before + 2) << "without holds too";
    EXPECT_EQ(daemon.fake.notifications.posts().back(), change);
}

TEST_F(Server, StopRefusesNewConnectionsAndServesOldOnes) {
    const auto old = daemon.connect();
    daemon.server->stop();
    EXPECT_EQ(daemon.ask(old, {{"request", "bulk"}, {"version", 3}}), Dictionary());
    EXPECT_EQ(daemon.ask("bulk"), (Dictionary{{"no", "reply"}}));
}

TEST_F(Server, UninstalledPlugInsHaveTheirInstancesEnded) {
    auto& fake = daemon.fake;
    fake.serviceManager.allow();
    fake.serviceManager.addInstance("com.example.a", "1");
    auto versionless = support::dataPlugIn("b");
    versionless.info = Dictionary{{"VBBundleIdentifier", "com.example.b"},
                                  {"VKExtension", *versionless.info.dictionary("VKExtension")}};
    const auto a = fake.registry.install(support::dataPlugIn("a"));
    const auto b = fake.registry.install(versionless);
    const auto c = fake.registry.install(support::dataPlugIn("c"));
    fake.serviceManager.fail("com.example.c", "1", 5);
    fake.registry.fireWillUninstall({a, b, c});
    fake.queues.runAll();
    EXPECT_EQ(fake.serviceManager.removals(),
              (std::vector<support::FakeServiceManager::Service>{
                  {"com.example.a", "1"}, {"com.example.b", "1"}, {"com.example.c", "1"}}));
    EXPECT_TRUE(processLog.contains(LogLevel::info, "ops",
                                    "one or more plug-ins have been terminated for uuid=" + a->uuid->text()));
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "ops",
                                    "ignitd reported no plug-ins on record for uuid=" + b->uuid->text()));
    EXPECT_TRUE(processLog.contains(
        LogLevel::error, "ops", "ignitd error attempting to terminate plug-ins: error=5 for uuid=" + c->uuid->text()));
    const auto lines = processLog.messages("ops");
    EXPECT_TRUE(lines.back().starts_with("removal complete for ")) << lines.back();
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "ops",
                                    "requesting termination for com.example.b((null)) ignitd:1 " + b->uuid->text()));
}

TEST_F(Server, TerminationIsAnsweredAfterTheLastInstance) {
    auto& fake = daemon.fake;
    fake.serviceManager.allow();
    fake.serviceManager.holdAnswers();
    std::vector<platform::PlugInProxyRef> proxies;
    for (const char* name : {"a", "b", "c"}) proxies.push_back(fake.registry.install(support::dataPlugIn(name)));
    int replies = 0;
    daemon.server->terminatePlugIns(proxies, [&] { ++replies; });
    fake.queues.runAll();
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(replies, 0);
        EXPECT_TRUE(processLog.contains(LogLevel::debug, "ops", "awaiting termination reply #" + std::to_string(i)));
        EXPECT_FALSE(
            processLog.contains(LogLevel::debug, "ops", "awaiting termination reply #" + std::to_string(i + 1)));
        ASSERT_TRUE(fake.serviceManager.answer());
        fake.queues.runAll();
    }
    EXPECT_EQ(replies, 1);
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "ops", "waiting for 3 termination replies"));
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "ops", "sending termination reply"));
    daemon.server->terminatePlugIns({}, [&] { ++replies; });
    fake.queues.runAll();
    EXPECT_EQ(replies, 2) << "nothing to wait for";
}

TEST_F(Server, ExclusionsAreReadAfreshEachTime) {
    EXPECT_FALSE(daemon.server->userPrefs().exclusions());
    daemon.fake.preferences.store("com.nordane.zembra.userprefs", "exclusions", Array{Dictionary()});
    EXPECT_EQ(daemon.server->userPrefs().exclusions(), Value(Array{Dictionary()}));
}

// The client connection.

TEST_F(Server, ClientIsLoggedThroughItsLife) {
    const auto connection = daemon.connect();
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "ops", "new client 77 /Applications/Host.app/host"));
    daemon.fake.transport.shutDownSending(connection);
    daemon.fake.transport.deliver();
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "ops", "client 77 termination imminent"));
    connection->cancel();
    daemon.fake.transport.deliver();
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "ops", "client 77 is dead"));
}

TEST_F(Server, UnexpectedEventsAreLoggedAndAnswersGoOn) {
    const auto connection = daemon.connect();
    daemon.fake.transport.sendValue(connection, Array{Value(1)});
    daemon.fake.transport.deliver();
    EXPECT_TRUE(processLog.contains(LogLevel::error, "ops", "unexpected message: (1) from: 77"))
        << testing::PrintToString(processLog.messages("ops"));
    EXPECT_EQ(daemon.ask(connection, {{"request", "bulk"}, {"version", 3}}), Dictionary());
}

TEST_F(Server, EveryThousandthRequestIsCounted) {
    const auto connection = daemon.connect();
    const auto used = [](int count) {
        return processLog.contains(LogLevel::debug, "ops",
                                   "client 77 used " + std::to_string(count) + " requests so far");
    };
    for (int i = 1; i <= 2000; ++i) {
        daemon.ask(connection, {{"request", "bulk"}, {"version", 3}});
        EXPECT_EQ(used(1000), i >= 1000) << i;
    }
    EXPECT_TRUE(used(2000));
    EXPECT_FALSE(used(999));
}

/// The daemon's end of a connection, and the client made for it.
struct Client : Server {
    std::shared_ptr<platform::Connection> host, accepted;
    std::shared_ptr<zbd::ZBDQmxClient> client;

    void SetUp() override { connectAs(daemon.peer); }
    void connectAs(const platform::AuditToken& peer) {
        std::tie(host, accepted) = daemon.fake.transport.makePair(peer, daemon.fake.queues.makeSerial("host"));
        host->setEventHandler([](const platform::ConnectionEvent&) {});
        host->resume();
        client = zbd::ZBDQmxClient::initWithConnection(accepted, daemon.server);
    }
};

TEST_F(Client, KnowsItsHost) {
    EXPECT_EQ(client->pid(), 77);
    EXPECT_EQ(client->path(), "/Applications/Host.app/host");
    EXPECT_TRUE(client->bundle());
    EXPECT_TRUE(client->acceptWork());
    EXPECT_TRUE(client->description().ends_with(" pid=77 path=/Applications/Host.app/host>")) << client->description();

    daemon.fake.processes.paths.clear();
    connectAs(daemon.peer);
    EXPECT_EQ(client->path(), "");
    EXPECT_FALSE(client->bundle());
}

TEST_F(Client, EntitlementsCountUnlessFalse) {
    daemon.fake.codeSigning.entitlements[77] =
        Dictionary{{"true", true}, {"false", false}, {"zero", 0}, {"text", "NO"}, {"array", Array()}};
    for (const char* held : {"true", "text", "array"}) EXPECT_TRUE(client->hasEntitlement(held)) << held;
    for (const char* lacking : {"false", "zero", "absent"}) EXPECT_FALSE(client->hasEntitlement(lacking)) << lacking;
    EXPECT_TRUE(processLog.messages("ops").size() == 1) << "only the line of the new client";

    // A value that comes with an error counts all the same.
    daemon.fake.codeSigning.failure = platform::Error{"x", 1, "why"};
    EXPECT_TRUE(client->hasEntitlement("true"));
    EXPECT_FALSE(client->hasEntitlement("absent"));
    EXPECT_TRUE(processLog.contains(LogLevel::error, "ops", "error retrieving entitlements for client 77"));
}

TEST_F(Client, DeathReleasesItsHoldsAndDropsWaitingRequests) {
    const auto ends = daemon.fake.transport.makePair(daemon.peer, daemon.fake.queues.makeSerial("other"));
    const auto other = zbd::ZBDQmxClient::initWithConnection(ends.second, daemon.server);
    const auto first = hold({plugIn("a")}, client);
    const auto kept = hold({}, other);
    const auto second = hold({}, client);
    const auto before = posts();

    daemon.fake.queues.setMode(support::FakeWorkQueues::Mode::manual);
    bool isAnswered = false;
    for (const char* type : {"bulk", "unknown"}) {
        host->sendWithReply(Dictionary{{"request", type}, {"version", 3}}, daemon.fake.queues.makeSerial("replies"),
                            [&](const platform::ReplyOrError& reply) {
                                isAnswered = isAnswered || std::holds_alternative<Dictionary>(reply);
                            });
    }
    daemon.fake.transport.deliver(); // the requests wait on the service queue
    client->dead();
    daemon.fake.queues.runAll();
    daemon.fake.transport.deliver();
    daemon.fake.queues.runAll();
    EXPECT_FALSE(isAnswered);
    EXPECT_FALSE(client->acceptWork());
    EXPECT_EQ(daemon.server->holds(), (zbd::ZBDServer::Holds{kept}));
    EXPECT_EQ(releases(), (std::vector<std::string>{
                              "releasing plug-in hold " + first->uuid().text() + " for dead client pid 77",
                              "releasing plug-in hold " + second->uuid().text() + " for dead client pid 77"}));
    EXPECT_EQ(posts(), before + 2);
}

TEST_F(Client, LivesAsLongAsItsConnection) {
    const std::weak_ptr<zbd::ZBDQmxClient> watched = client;
    client.reset();
    EXPECT_FALSE(watched.expired());
    host->cancel();
    daemon.fake.transport.deliver();
    accepted.reset();
    EXPECT_TRUE(watched.expired());
}

} // namespace
