#include "tests/support/FakeDaemon.h"
#include "zbd/ZBDQmxClient.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::logged;
using support::processLog;
using zbd::ZBDPlugInHold;

const Dictionary bulk{{"request", "bulk"}, {"version", 3}};

struct Server : testing::Test {
    support::FakeDaemon daemon;
    support::FakePlatform& fake = daemon.fake;

    std::shared_ptr<ZBDPlugInHold> hold(const std::vector<zbd::ZBDPlugInRef>& plugIns,
                                        const std::shared_ptr<zbd::ZBDQmxClient>& client = nullptr) {
        auto made = ZBDPlugInHold::initWithPlugIns(fake.transport, plugIns, client);
        daemon.server->addHold(made);
        return made;
    }
    std::size_t posts() { return fake.notifications.posts().size(); }
    /// Expects these lines of released holds, in this order, and no others.
    static void expectReleased(const std::vector<std::shared_ptr<ZBDPlugInHold>>& holds, const std::string& why) {
        std::vector<std::string> expected;
        for (const auto& hold : holds) expected.push_back("releasing plug-in hold " + hold->uuid().text() + why);
        auto lines = processLog.messages("ops");
        std::erase_if(lines, [](const auto& line) { return !line.starts_with("releasing plug-in hold "); });
        EXPECT_EQ(lines, expected);
    }
};

TEST_F(Server, ConstructionMakesTheQueuesAndTheSingleton) {
    std::set<std::pair<std::string, QualityOfService>> made;
    for (const auto& queue : fake.queues.made) made.emplace(queue.label, queue.quality);
    using enum QualityOfService;
    for (const auto& [label, quality] :
         {std::pair{"qmx", standard}, {"service", userInitiated}, {"serverSync", standard}}) {
        EXPECT_TRUE(made.contains({label, quality})) << label;
    }
    EXPECT_EQ(zbd::ZBDServer::server(), daemon.server);
    EXPECT_EQ(daemon.server->delegate(), daemon.server);
    EXPECT_EQ(daemon.server->cacheLimit(), 1'000'000U);
}

TEST_F(Server, WithoutItsNameOrItsAnnotationsThereIsNone) {
    EXPECT_FALSE(zbd::ZBDServer::initForService(fake.platform, zembra::serviceName, std::nullopt));
    EXPECT_TRUE(logged(LogLevel::error, "unable to listen for com.nordane.zembra.zbd: service name taken"));
    fake.transport.allowService("free");
    EXPECT_TRUE(zbd::ZBDServer::initForService(fake.platform, "free", std::nullopt));
    fake.containers.failure = 13;
    fake.transport.allowService("another");
    EXPECT_FALSE(zbd::ZBDServer::initForService(fake.platform, "another", std::nullopt));
}

TEST_F(Server, ConnectionBeforeRunIsServedAfterIt) {
    fake.transport.allowService("other");
    const auto server = zbd::ZBDServer::initForService(fake.platform, "other", std::nullopt);
    const auto connection = daemon.connect("other");
    EXPECT_EQ(daemon.ask(connection, bulk), std::nullopt);
    server->run();
    EXPECT_EQ(fake.runLoop.runs, 1);
    EXPECT_EQ(daemon.ask(connection, bulk), Dictionary());
}

TEST_F(Server, ListenerErrorsAreLoggedAndIgnored) {
    const auto inject = [&](const Listener::Event& event) { fake.transport.inject(daemon.server->service(), event); };
    inject(TransportError{TransportErrorKind::connectionInvalid, "gone"});
    inject(TransportError{TransportErrorKind::other, "odd"});
    inject(Value("what"));
    EXPECT_EQ(daemon.ask("bulk"), Dictionary());
    EXPECT_TRUE(logged(LogLevel::standard, "potentially unexpected error from qmx: gone"));
    EXPECT_TRUE(logged(LogLevel::error, "unexpected error from qmx: odd"));
    EXPECT_TRUE(logged(LogLevel::error, "unexpected message: what"));
}

TEST_F(Server, HoldsBlockUntilTheirTokenReleasesThem) {
    const auto a = daemon.plugIn("a");
    const auto b = daemon.plugIn("b");
    const auto first = hold({a, a});
    const auto second = hold({a, b});
    EXPECT_EQ(first->blocked().size(), 1U);
    daemon.server->unholdToken(UUID::random());
    expectReleased({}, "");
    EXPECT_EQ(posts(), 2U);
    EXPECT_EQ(fake.transport.activityCount(), 2U) << "the daemon stays for each";

    daemon.server->unholdToken(first->uuid());
    EXPECT_TRUE(daemon.server->holdOnPlugIn(a)) << "the other hold stands";
    daemon.server->unholdToken(second->uuid());
    for (const auto& plugIn : {a, b}) EXPECT_FALSE(daemon.server->holdOnPlugIn(plugIn));
    EXPECT_EQ(posts(), 4U);
    expectReleased({first, second}, " at client's request");
}

TEST_F(Server, HoldEndsItsKeepAliveActivity) {
    daemon.server->unholdToken(hold({})->uuid());
    EXPECT_EQ(fake.transport.activityCount(), 0U);
}

TEST_F(Server, StopReleasesTheHoldsAndServesOldConnectionsOnly) {
    const auto old = daemon.connect();
    const auto first = hold({daemon.plugIn("a")});
    const auto second = hold({});
    const auto before = posts();
    daemon.server->stop();
    expectReleased({first, second}, " because server is stopping");
    EXPECT_TRUE(daemon.server->holds().empty());
    EXPECT_EQ(posts(), before + 1);
    daemon.server->stop();
    EXPECT_EQ(posts(), before + 2) << "without holds too";
    EXPECT_EQ(fake.notifications.posts().back(), "com.nordane.zembra.annotation-change");
    EXPECT_EQ(daemon.ask(old, bulk), Dictionary());
    EXPECT_EQ(daemon.ask("bulk"), (Dictionary{{"no", "reply"}}));
}

TEST_F(Server, UninstalledPlugInsHaveTheirInstancesEnded) {
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
    EXPECT_TRUE(logged(LogLevel::info, "one or more plug-ins have been terminated for uuid=" + a->uuid->text()));
    EXPECT_TRUE(logged(LogLevel::debug, "ignitd reported no plug-ins on record for uuid=" + b->uuid->text()));
    EXPECT_TRUE(
        logged(LogLevel::error, "ignitd error attempting to terminate plug-ins: error=5 for uuid=" + c->uuid->text()));
    EXPECT_TRUE(processLog.messages("ops").back().starts_with("removal complete for "));
}

TEST_F(Server, TerminationIsAnsweredAfterTheLastInstance) {
    fake.serviceManager.allow();
    fake.serviceManager.holdAnswers();
    std::vector<PlugInProxyRef> proxies;
    for (const char* name : {"a", "b", "c"}) proxies.push_back(fake.registry.install(support::dataPlugIn(name)));
    int replies = 0;
    daemon.server->terminatePlugIns(proxies, [&] { ++replies; });
    for (std::size_t i = 0; i < proxies.size(); ++i) {
        fake.queues.runAll();
        EXPECT_EQ(replies, 0);
        EXPECT_EQ(processLog.messages("ops").back(), "awaiting termination reply #" + std::to_string(i));
        ASSERT_TRUE(fake.serviceManager.answer());
    }
    fake.queues.runAll();
    EXPECT_EQ(replies, 1);
    daemon.server->terminatePlugIns({}, [&] { ++replies; });
    fake.queues.runAll();
    EXPECT_EQ(replies, 2) << "nothing to wait for";
}

TEST_F(Server, ExclusionsAreReadAfreshEachTime) {
    EXPECT_FALSE(daemon.server->userPrefs().exclusions());
    fake.preferences.store("com.nordane.zembra.userprefs", "exclusions", Array{Dictionary()});
    EXPECT_EQ(daemon.server->userPrefs().exclusions(), Value(Array{Dictionary()}));
}

TEST_F(Server, ClientIsLoggedThroughItsLife) {
    const auto connection = daemon.connect();
    EXPECT_TRUE(logged(LogLevel::debug, "new client 77 /Applications/Host.app/host"));
    fake.transport.sendValue(connection, Array{Value(1)});
    for (int i = 1; i <= 1000; ++i) {
        EXPECT_FALSE(logged(LogLevel::debug, "client 77 used")) << i;
        EXPECT_EQ(daemon.ask(connection, bulk), Dictionary());
    }
    EXPECT_TRUE(logged(LogLevel::error, "unexpected message: (1) from: 77"));
    EXPECT_TRUE(logged(LogLevel::debug, "client 77 used 1000 requests so far"));
    fake.transport.shutDownSending(connection);
    fake.transport.deliver();
    EXPECT_TRUE(logged(LogLevel::debug, "client 77 termination imminent"));
    connection->cancel();
    fake.transport.deliver();
    EXPECT_TRUE(logged(LogLevel::debug, "client 77 is dead"));
}

/// The daemon's end of a connection, and the client made for it.
struct Client : Server {
    std::shared_ptr<Connection> host, accepted;
    std::shared_ptr<zbd::ZBDQmxClient> client;

    void SetUp() override {
        std::tie(host, accepted) = fake.transport.makePair(daemon.peer, fake.queues.makeSerial("host"));
        host->setEventHandler([](const ConnectionEvent&) {});
        host->resume();
        client = zbd::ZBDQmxClient::initWithConnection(accepted, daemon.server);
    }
};

TEST_F(Client, KnowsItsHost) {
    EXPECT_EQ(client->pid(), 77);
    EXPECT_EQ(client->path(), "/Applications/Host.app/host");
    EXPECT_TRUE(client->bundle());
    EXPECT_TRUE(client->acceptWork());
    fake.processes.paths.clear();
    SetUp();
    EXPECT_EQ(client->path(), "");
    EXPECT_FALSE(client->bundle());
}

TEST_F(Client, EntitlementsCountUnlessFalse) {
    fake.codeSigning.entitlements[77] =
        Dictionary{{"true", true}, {"false", false}, {"zero", 0}, {"text", "NO"}, {"array", Array()}};
    for (const bool isFailing : {false, true}) {
        // A value that comes with an error counts all the same.
        if (isFailing) fake.codeSigning.failure = Error{"x", 1, "why"};
        for (const char* held : {"true", "text", "array"}) EXPECT_TRUE(client->hasEntitlement(held)) << held;
        for (const char* lacking : {"false", "zero", "absent"})
            EXPECT_FALSE(client->hasEntitlement(lacking)) << lacking;
        EXPECT_EQ(logged(LogLevel::error, "error retrieving entitlements for client 77"), isFailing);
    }
}

TEST_F(Client, DeathReleasesItsHoldsAndDropsWaitingRequests) {
    const auto ends = fake.transport.makePair(daemon.peer, fake.queues.makeSerial("other"));
    const auto other = zbd::ZBDQmxClient::initWithConnection(ends.second, daemon.server);
    const auto first = hold({daemon.plugIn("a")}, client);
    const auto kept = hold({}, other);
    const auto second = hold({}, client);
    const auto before = posts();

    fake.queues.setMode(support::FakeWorkQueues::Mode::manual);
    bool isAnswered = false;
    for (const char* type : {"bulk", "match"}) {
        host->sendWithReply(
            Dictionary{{"request", type}, {"version", 3}}, fake.queues.makeSerial("replies"),
            [&](const ReplyOrError& reply) { isAnswered |= std::holds_alternative<Dictionary>(reply); });
    }
    fake.transport.deliver(); // the requests wait on the service queue
    client->dead();
    fake.queues.runAll();
    fake.transport.deliver();
    fake.queues.runAll();
    EXPECT_FALSE(isAnswered);
    EXPECT_FALSE(client->acceptWork());
    EXPECT_EQ(daemon.server->holds(), (zbd::ZBDServer::Holds{kept}));
    expectReleased({first, second}, " for dead client pid 77");
    EXPECT_EQ(posts(), before + 2);
}

TEST_F(Client, LivesAsLongAsItsConnection) {
    const std::weak_ptr<zbd::ZBDQmxClient> watched = client;
    client.reset();
    EXPECT_FALSE(watched.expired());
    host->cancel();
    fake.transport.deliver();
    accepted.reset();
    EXPECT_TRUE(watched.expired());
}

} // namespace
