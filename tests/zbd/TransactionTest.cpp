#include "tests/support/Requests.h"

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

TEST_F(Transaction, VersionIsJudgedBeforeTheType) {
    const auto reply = daemon.ask(daemon.connect(), {{"request", "Bulk"}, {"version", 1}});
    EXPECT_EQ(reply, errorReply(7, "unsupported protocol version 1 (current 3)"));
    EXPECT_EQ(daemon.ask("Bulk"), errorReply(4, "unrecognized request"));
    expectLogged(debug, "client 77 requested Bulk");
}

TEST_F(Transaction, AddGoesAsFarAsTheFirstPathThatItMayNotRegister) {
    fake.files.links["/link"] = "/real";
    registry.close("/closed");
    EXPECT_EQ(ask("add", {"/link", "/also"}), succeeded);
    EXPECT_EQ(changed, (Names{"/real", "/also"}));
    for (const auto& [bad, reply] : {std::pair(Value(7), errorReply(4, "invalid request format")),
                                     {"rel/ative", errorReply(9, "absolute path required: rel/ative")},
                                     {"/missing", errorReply(9, "invalid plugin path: /missing")},
                                     {"/closed", errorReply(2, "unable to register plug-in at /closed")}}) {
        EXPECT_EQ(ask("add", {"/link", bad, "/also"}), reply);
        EXPECT_EQ(changed, Names{"/real"}) << "what came before stays";
    }
    EXPECT_EQ(registry.calls("registerPlugIn"), 6) << "not of what is closed to the client";
    registry.before("registerPlugIn", [&] { registry.allowRegistration(false); });
    EXPECT_EQ(ask("add", {"/real"}), errorReply(2, "unable to register plug-in at /real"));
    expectLogged(standard, "failed to register plug-in at /real");
    daemon.peer.uid = 1; // who sees nothing here
    fake.transport.setPeer(daemon.peer);
    EXPECT_EQ(ask("add", {"/real"}), errorReply(9, "invalid plugin path: /real"));
}

TEST_F(Transaction, RemoveNeedsTheManagerEntitlementAndNoFile) {
    EXPECT_EQ(ask("remove", {"/missing"}), errorReply(11, "caller lacks entitlement for this operation"));
    expectLogged(standard,
                 "refused request from pid=77 to remove plug-in at /missing - client lacks required entitlement", "");
    grant({{"com.nordane.private.zembra.manager", true}});
    EXPECT_EQ(ask("remove", {"/missing", "/other"}), succeeded);
    EXPECT_EQ(changed, (Names{"/missing", "/other"}));
}

TEST_F(Transaction, RequestsOfAllClientsAreServedWholeInTheOrderTheyCame) {
    const auto client = daemon.connect();
    const auto other = daemon.connect();
    const auto replies = fake.queues.makeSerial("replies");
    fake.queues.setMode(support::FakeWorkQueues::Mode::manual);
    Names answered;
    const auto addAndOthers = [&] {
        registry.resetCalls();
        answered.clear();
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
    fake.processAssertions.addIncomplete("com.example.2");
    fake.processAssertions.addBusy("com.example.2");
    fake.processAssertions.addIncomplete("com.example.3");
    auto refusal = MutableDictionary::copyOf(errorReply(14, "plug-ins are busy"));
    refusal.set("conflicts", Array{Dictionary{{"VBBundleIdentifier", "com.example.2"}}});
    EXPECT_EQ(lock(client, application, 2), refusal);
    EXPECT_TRUE(daemon.server->holds().empty());
    expectLogged(error, "vigild reported incomplete bundle for plug-in com.example.3/" + idOf(3));
    EXPECT_TRUE(lock(client, pathOf(1), 1 | 2)->uuid("uuids"));
}

TEST_F(Lock, ForcedHoldIsAnsweredAfterEveryTermination) {
    fake.serviceManager.allow();
    fake.serviceManager.holdAnswers();
    EXPECT_FALSE(lock(client, application, 4));
    EXPECT_TRUE(daemon.server->holdOnPlugIn(record(1))) << "held while it waits";
    EXPECT_EQ(daemon.ask("bulk"), succeeded) << "others are served";
    const std::string token = daemon.server->holds().front()->uuid().text();
    for (int answered = 0; answered < 3; ++answered) {
        EXPECT_FALSE(support::logged(info, "forced termination complete; hold request granted uuid:"));
        EXPECT_TRUE(fake.serviceManager.answer());
    }
    expectLogged(info, "forced termination complete; hold request granted uuid:" + token);
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
    EXPECT_EQ(daemon.server->holds().size(), 1U);
    EXPECT_TRUE(daemon.server->holdOnPlugIn(record(1)));
    EXPECT_FALSE(daemon.server->holdOnPlugIn(record(2)));
}

} // namespace
