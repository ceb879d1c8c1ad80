#include "tests/support/Requests.h"

#include <gmock/gmock.h>

namespace {

using namespace platform;
using support::errorReply;
using Names = std::vector<std::string>;

struct Transaction : support::Requests {
    support::FakeRegistry& registry = fake.registry;
    Names changed; // paths registered or unregistered

    Transaction() {
        registry.allowRegistration();
        registry.onRegister([&](const URL& url) { changed.push_back(url.path()); });
        registry.onUnregister([&](const URL& url) { changed.push_back(url.path()); });
        for (const char* directory : {"/real", "/also", "/closed"}) fake.files.addDirectory(directory);
    }
    Dictionary ask(const std::string& type, const Array& paths) {
        changed.clear();
        return daemon.ask(type, {{"paths", paths}});
    }
};

TEST_F(Transaction, AddGoesAsFarAsTheFirstPathThatItMayNotRegister) {
    fake.files.links["/link"] = "/real";
    registry.close("/closed");
    EXPECT_EQ(ask("add", {"/link", "/also"}), succeeded);
    EXPECT_EQ(changed, (Names{"/real", "/also"}));
    for (const auto& [bad, reply] : {std::pair(Value(7), errorReply(4, "invalid request format")),
                                     {"/missing", errorReply(9, "invalid plugin path: /missing")},
                                     {"/closed", errorReply(2, "unable to register plug-in at /closed")}}) {
        EXPECT_EQ(ask("add", {"/link", bad, "/also"}), reply);
        EXPECT_EQ(changed, Names{"/real"}) << "what came before stays";
    }
    EXPECT_EQ(registry.calls("registerPlugIn"), 5) << "not of what is closed to the client";
}

TEST_F(Transaction, RemoveNeedsNoFileAndAnEntitlementThatIsNotFalse) {
    fake.codeSigning.failure = Error{"x", 1, "why"}; // a value that comes with it counts all the same
    for (const auto& [value, counts] : {std::pair(Value("NO"), true), {Array(), true}, {false, false}, {0, false}}) {
        grant({{zembra::entitlement::manager, value}});
        const auto refusal = errorReply(11, "caller lacks entitlement for this operation");
        EXPECT_EQ(ask("remove", {"/missing", "/other"}), counts ? succeeded : refusal) << value.description();
        EXPECT_EQ(changed, counts ? Names({"/missing", "/other"}) : Names());
    }
    expectLogged(error, "error retrieving entitlements for client 77");
}

TEST_F(Transaction, RequestsOfAllClientsAreServedWholeInTheOrderTheyCame) {
    const auto client = daemon.connect();
    const auto other = daemon.connect();
    const auto replies = fake.queues.makeSerial("replies");
    fake.queues.setMode(support::FakeWorkQueues::Mode::manual);
    const auto addAndOthers = [&] {
        registry.resetCalls();
        Names answered;
        for (const auto& [from, type] : {std::pair(client, "add"), {other, "find"}, {client, "bulk"}}) {
            const Dictionary request{{"request", type}, {"version", 3}, {"paths", Array::of(Names(100, "/real"))}};
            from->sendWithReply(request, replies, [&answered, name = type](const ReplyOrError& reply) {
                if (std::holds_alternative<Dictionary>(reply)) answered.push_back(name);
            });
        }
        while (fake.transport.deliver() > 0 || fake.queues.runOne()) {
        }
        EXPECT_EQ(registry.calls("registerPlugIn"), 100);
        return answered;
    };
    EXPECT_EQ(addAndOthers(), (Names{"add", "find", "bulk"}));
    registry.onRegister([&](const URL&) { client->cancel(); });
    EXPECT_EQ(addAndOthers(), Names{"find"}) << "what was begun is finished";
}

struct Lock : support::Requests {
    const std::shared_ptr<Connection> client = daemon.connect();

    Lock() {
        fake.files.addDirectory(application);
        installThree();
    }
    /// The reply; none when it has not come.
    std::optional<Dictionary> lock(const std::shared_ptr<Connection>& from, const std::string& path, int flags) {
        return daemon.ask(from, {{"request", "lock"}, {"version", 3}, {"paths", Array{path}}, {"flags", flags}});
    }
};

TEST_F(Lock, BusyInstancesRefuseItWhenAsked) {
    fake.processAssertions.addBusy("com.example.2");
    auto refusal = MutableDictionary::copyOf(errorReply(14, "plug-ins are busy"));
    refusal.set("conflicts", Array{Dictionary{{"VBBundleIdentifier", "com.example.2"}}});
    EXPECT_EQ(lock(client, application, 2), refusal);
    EXPECT_TRUE(daemon.server->holds().empty());
    fake.processAssertions.addIncomplete("com.example.1");
    EXPECT_TRUE((*lock(client, pathOf(1), 3))["uuids"].uuid()) << "an instance that does not say whose it is";
    EXPECT_TRUE(support::logged(error, "vigild reported incomplete bundle for plug-in com.example.1/" + idOf(1)));
}

TEST_F(Lock, ForcedHoldIsAnsweredAfterEveryTermination) {
    fake.serviceManager.holdAnswers();
    EXPECT_FALSE(lock(client, application, 4));
    EXPECT_TRUE(daemon.server->holdOnPlugIn(record(1))) << "held while it waits";
    for (int answered = 0; answered < 3; ++answered) {
        EXPECT_FALSE(support::logged(info, "forced termination complete; hold request granted uuid:"));
        EXPECT_TRUE(fake.serviceManager.answer());
    }
    expectLogged(info, "forced termination complete; hold request granted uuid:" +
                           daemon.server->holds().front()->uuid().text());
}

TEST_F(Lock, HoldsKeepTheServerAliveUntilTheirTokenOrItsStop) {
    const UUID first = hold(1), second = hold(1);
    EXPECT_EQ(fake.transport.activityCount(), 2U);
    for (const UUID& token : {first, first, UUID::random()}) daemon.server->unholdToken(token);
    EXPECT_EQ(posts(), 3U);
    EXPECT_TRUE(daemon.server->holdOnPlugIn(record(1))) << "the other stands";
    for (const std::size_t postsAfter : {4U, 5U}) {
        daemon.server->stop();
        EXPECT_EQ(posts(), postsAfter) << "without holds too";
    }
    EXPECT_EQ(daemon.ask(client, {{"request", "bulk"}, {"version", 3}}), succeeded);
    EXPECT_EQ(daemon.ask("bulk"), (Dictionary{{"no", "reply"}})) << "new connections are refused";
    expectLogged(debug, "releasing plug-in hold " + first.text() + " at client's request");
    expectLogged(debug, "releasing plug-in hold " + second.text() + " because server is stopping");
}

TEST_F(Lock, DeathReleasesThatClientsHoldsAloneAndTheOneBeingMade) {
    lock(daemon.connect(), pathOf(1), 1);
    lock(client, application, 0);
    // The connection ends while the request is being served, before the hold is made.
    fake.registry.before("plugInsOfApplication", [&] {
        client->cancel();
        fake.transport.deliver();
    });
    lock(client, application, 2);
    EXPECT_EQ(posts(), 5U) << "each made, two released";
    const auto line = testing::MatchesRegex("releasing plug-in hold .* for dead client pid 77");
    EXPECT_THAT(support::processLog.messages("ops"), testing::Contains(line).Times(2));
    EXPECT_TRUE(daemon.server->holdOnPlugIn(record(1)));
    EXPECT_FALSE(daemon.server->holdOnPlugIn(record(2)));
}

} // namespace
