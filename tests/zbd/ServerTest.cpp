#include "tests/support/FakeDaemon.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::logged;
using support::processLog;

Dictionary request(const char* type) { return {{"request", type}, {"version", 3}, {"paths", Array()}}; }

struct Server : testing::Test {
    support::FakeDaemon daemon;
    support::FakePlatform& fake = daemon.fake;
};

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

TEST_F(Server, HoldsKeepItAliveUntilTheirTokenOrItsStopReleasesThem) {
    const auto posts = [&] { return fake.notifications.posts().size(); };
    const auto plugIn = daemon.plugIn("a");
    const auto hold = [&] {
        const auto made = zbd::ZBDPlugInHold::initWithPlugIns(fake.transport, {plugIn, plugIn}, nullptr);
        daemon.server->addHold(made);
        return made->uuid();
    };
    const UUID first = hold();
    const UUID second = hold();
    EXPECT_EQ(fake.transport.activityCount(), 2U);
    for (const UUID& token : {first, first, UUID::random()}) daemon.server->unholdToken(token);
    EXPECT_EQ(posts(), 3U);
    EXPECT_TRUE(daemon.server->holdOnPlugIn(plugIn)) << "the other stands";
    const auto old = daemon.connect();
    for (const std::size_t postsAfter : {4U, 5U}) {
        daemon.server->stop();
        EXPECT_FALSE(daemon.server->holdOnPlugIn(plugIn));
        EXPECT_EQ(posts(), postsAfter) << "without holds too";
    }
    EXPECT_EQ(fake.transport.activityCount(), 0U);
    EXPECT_EQ(daemon.ask(old, request("bulk")), Dictionary());
    EXPECT_EQ(daemon.ask("bulk"), (Dictionary{{"no", "reply"}})) << "new connections are refused";
    EXPECT_EQ(fake.notifications.posts().back(), "com.nordane.zembra.annotation-change");
    const std::string start = "releasing plug-in hold ";
    EXPECT_TRUE(logged(LogLevel::debug, start + first.text() + " at client's request"));
    EXPECT_TRUE(logged(LogLevel::debug, start + second.text() + " because server is stopping"));
}

TEST_F(Server, UninstalledPlugInsHaveTheirInstancesEnded) {
    fake.serviceManager.allow();
    fake.serviceManager.holdAnswers();
    fake.serviceManager.addInstance("com.example.a", "1");
    fake.serviceManager.fail("com.example.c", "1", 5);
    std::vector proxies{fake.install("a"), fake.install("b"), fake.install("c")};
    auto versionless = *proxies[1];
    versionless.infoDictionary.reset();
    proxies[1] = fake.registry.install(versionless);
    fake.registry.fireWillUninstall(proxies);
    const std::pair<LogLevel, const char*> results[] = {
        {LogLevel::info, "one or more plug-ins have been terminated for uuid="},
        {LogLevel::debug, "ignitd reported no plug-ins on record for uuid="},
        {LogLevel::error, "ignitd error attempting to terminate plug-ins: error=5 for uuid="}};
    for (std::size_t i = 0; i < proxies.size(); ++i) {
        const auto& [level, line] = results[i];
        const std::string identifier = *proxies[i]->bundleIdentifier;
        const std::string uuid = proxies[i]->uuid->text();
        EXPECT_TRUE(logged(LogLevel::standard, "plug-in UNINSTALLED:" + identifier + " " + identifier + "(1) " + uuid +
                                                   " " + proxies[i]->bundleURL->path()));
        EXPECT_EQ(fake.serviceManager.removals()[i], std::pair(identifier, std::string("1")));
        EXPECT_EQ(processLog.messages("ops").back(), "awaiting termination reply #" + std::to_string(i));
        EXPECT_TRUE(fake.serviceManager.answer());
        EXPECT_TRUE(logged(level, line + uuid));
    }
    EXPECT_TRUE(processLog.messages("ops").back().starts_with("removal complete for "));
}

TEST_F(Server, ClientIsLoggedThroughItsLife) {
    const auto connection = daemon.connect();
    EXPECT_TRUE(logged(LogLevel::debug, "new client 77 /Applications/Host.app/host"));
    fake.transport.sendValue(connection, Array{Value(1)});
    EXPECT_TRUE(daemon.ask(connection, request("lock")));
    const std::weak_ptr client = daemon.server->holds().front()->client();
    for (int i = 2; i <= 1000; ++i) {
        EXPECT_FALSE(logged(LogLevel::debug, "client 77 used")) << i;
        EXPECT_EQ(daemon.ask(connection, request("bulk")), Dictionary());
    }
    EXPECT_TRUE(logged(LogLevel::error, "unexpected message: (1) from: 77"));
    EXPECT_TRUE(logged(LogLevel::debug, "client 77 used 1000 requests so far"));
    fake.queues.setMode(support::FakeWorkQueues::Mode::manual);
    daemon.ask(connection, request("bulk"));
    fake.transport.shutDownSending(connection);
    fake.transport.deliver();
    EXPECT_TRUE(logged(LogLevel::debug, "client 77 termination imminent"));
    connection->cancel();
    fake.transport.deliver();
    fake.queues.runAll();
    EXPECT_EQ(processLog.messages("ops").back(), "client 77 is dead") << "the request that waited is dropped";
    EXPECT_TRUE(client.expired());
}

TEST_F(Server, EntitlementsOfClientsCountUnlessFalse) {
    fake.registry.allowRegistration();
    const auto mayRemove = [&](const Dictionary& entitlements) {
        fake.codeSigning.entitlements[77] = entitlements;
        return daemon.ask("remove", {{"paths", Array{"/a"}}}).empty();
    };
    for (const auto& [value, counts] : {std::pair(Value("NO"), true), {Array(), true}, {false, false}, {0, false}})
        EXPECT_EQ(mayRemove({{zembra::entitlement::manager, value}}), counts) << value.description();
    EXPECT_FALSE(mayRemove({}));
    fake.codeSigning.failure = Error{"x", 1, "why"}; // a value that comes with it counts all the same
    EXPECT_TRUE(mayRemove({{zembra::entitlement::manager, true}}));
    EXPECT_TRUE(logged(LogLevel::error, "error retrieving entitlements for client 77"));
}

} // namespace
