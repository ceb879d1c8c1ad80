#include "tests/support/FakeDaemon.h"
#include "zbd/Transaction.h"

#include <gtest/gtest.h>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::LogLevel;
using platform::MutableDictionary;
using platform::URL;
using platform::Value;
using support::errorReply;
using support::processLog;

struct Hold : testing::Test {
    support::FakeDaemon daemon;
    std::vector<support::FakePlugIn> plugIns;

    Hold() {
        const auto application = daemon.fake.registry.installApplication({URL::file("/Applications/A.app"), "a", "A"});
        daemon.fake.registry.installApplication({URL::file("/Applications/Empty.app"), "e", "E"});
        for (const char* path : {"/Applications/A.app", "/Applications/Empty.app", "/elsewhere"}) {
            daemon.fake.files.addDirectory(path);
        }
        for (const char* name : {"one", "two", "three"}) {
            auto plugIn = support::dataPlugIn(name);
            plugIn.path = "/Applications/A.app/PlugIns/" + std::string(name) + ".plugin";
            plugIn.containingBundle = application;
            plugIn.onSystemPartition = false;
            daemon.fake.files.addDirectory(plugIn.path);
            daemon.fake.registry.install(plugIn);
            plugIns.push_back(plugIn);
        }
    }
    Dictionary lock(const std::string& path, std::uint64_t flags = 0) {
        return daemon.ask("lock", {{"paths", Array{path}}, {"flags", flags}});
    }
    bool isHeld(std::size_t index) {
        return daemon.server->holdOnPlugIn(daemon.server->findPlugIn(*plugIns[index].uuid));
    }
    std::size_t posts() const { return daemon.fake.notifications.posts().size(); }
};

TEST_F(Hold, PathsNameApplicationsOrPlugIns) {
    EXPECT_EQ(lock("/missing"), errorReply(9, "invalid path: /missing"));
    EXPECT_EQ(lock("/elsewhere", 1), errorReply(9, "no plug-in at path:/elsewhere"));
    EXPECT_TRUE(daemon.server->holds().empty());
    const auto client = daemon.connect();
    const auto ask = [&](const std::string& path, std::uint64_t flags) {
        return *daemon.ask(client, {{"request", "lock"}, {"version", 3}, {"paths", Array{path}}, {"flags", flags}});
    };
    EXPECT_TRUE(ask("/Applications/Empty.app", 0).uuid("uuids"));
    EXPECT_FALSE(isHeld(0));
    const auto before = posts();
    const auto one = ask(plugIns[0].path, 1).uuid("uuids");
    EXPECT_EQ(posts(), before + 1);
    EXPECT_TRUE(isHeld(0));
    EXPECT_FALSE(isHeld(1));
    EXPECT_TRUE(ask("/Applications/A.app", 0).uuid("uuids"));
    EXPECT_TRUE(isHeld(1));

    // Any client may release, an unknown token succeeds, and the other hold on the same plug-in stands.
    EXPECT_EQ(daemon.ask("lock", {{"uuids", Array{"no token", platform::UUID::random(), *one}}, {"paths", 7}}),
              Dictionary());
    EXPECT_TRUE(
        processLog.contains(LogLevel::debug, "ops", "releasing plug-in hold " + one->text() + " at client's request"));
    EXPECT_TRUE(isHeld(0));
    // The death of the client releases the rest, each with its notification.
    const auto beforeDeath = posts();
    client->cancel();
    daemon.fake.transport.deliver();
    EXPECT_FALSE(isHeld(0));
    EXPECT_TRUE(daemon.server->holds().empty());
    EXPECT_EQ(posts(), beforeDeath + 2);
}

TEST_F(Hold, BusyInstancesRefuseItWhenAsked) {
    daemon.fake.processAssertions.addIncomplete("com.example.two");
    daemon.fake.processAssertions.addBusy("com.example.two");
    daemon.fake.processAssertions.addIncomplete("com.example.three");
    auto refusal = MutableDictionary::copyOf(errorReply(14, "plug-ins are busy"));
    refusal.set("conflicts", Array{Dictionary{{"VBBundleIdentifier", "com.example.two"}}});
    EXPECT_EQ(lock("/Applications/A.app", 2), refusal);
    EXPECT_TRUE(daemon.server->holds().empty());
    EXPECT_TRUE(processLog.contains(LogLevel::error, "ops",
                                    "vigild reported incomplete bundle for plug-in com.example.three/" +
                                        plugIns[2].uuid->text()));
    EXPECT_TRUE(lock("/Applications/A.app", 0).uuid("uuids"));
    EXPECT_TRUE(lock(plugIns[0].path, 1 | 2).uuid("uuids"));
}

TEST_F(Hold, ForcedHoldsAnswerAfterEveryTermination) {
    daemon.fake.serviceManager.allow();
    daemon.fake.serviceManager.holdAnswers();
    const auto client = daemon.connect();
    std::optional<Dictionary> reply;
    client->sendWithReply(
        Dictionary{{"request", "lock"}, {"version", 3}, {"paths", Array{"/Applications/A.app"}}, {"flags", 4}},
        daemon.fake.queues.makeSerial("replies"),
        [&](const platform::ReplyOrError& answer) { reply = std::get<Dictionary>(answer); });
    daemon.fake.transport.deliver();
    EXPECT_TRUE(isHeld(0)) << "held while it waits";
    EXPECT_EQ(daemon.ask("bulk"), Dictionary()) << "others are served";
    for (int answered = 0; answered < 3; ++answered) {
        EXPECT_FALSE(reply);
        EXPECT_TRUE(daemon.fake.serviceManager.answer());
        daemon.fake.transport.deliver();
    }
    ASSERT_TRUE(reply && reply->uuid("uuids"));
    EXPECT_TRUE(
        processLog.contains(LogLevel::info, "ops",
                            "forced termination complete; hold request granted uuid:" + reply->uuid("uuids")->text()));
    EXPECT_TRUE(lock("/Applications/Empty.app", 4).uuid("uuids")) << "with nothing to end it is answered at once";
}

TEST_F(Hold, AClientThatDiedMeanwhileLeavesNone) {
    const auto client = daemon.connect();
    const auto before = posts();
    // The connection ends while the request is being served, before the hold is made.
    daemon.fake.registry.before("plugInsOfApplication", [&] {
        client->cancel();
        daemon.fake.transport.deliver();
    });
    client->sendWithReply(
        Dictionary{{"request", "lock"}, {"version", 3}, {"paths", Array{"/Applications/A.app"}}, {"flags", 2}},
        daemon.fake.queues.makeSerial("replies"), [](const platform::ReplyOrError&) {});
    daemon.fake.transport.deliver();
    EXPECT_EQ(posts(), before + 2) << "made and released";
    EXPECT_FALSE(isHeld(0));
}

TEST_F(Hold, ADeathReleasesThatClientsHoldsAlone) {
    const auto other = daemon.connect();
    const auto hold = [&](const auto& client) {
        const auto reply =
            daemon.ask(client, {{"request", "lock"}, {"version", 3}, {"paths", Array{plugIns[0].path}}, {"flags", 1}});
        return *reply->uuid("uuids");
    };
    const auto client = daemon.connect();
    hold(client);
    const auto kept = hold(other);
    for (int i = 0; i < 129; ++i) hold(client);
    const auto before = posts();
    client->cancel();
    daemon.fake.transport.deliver();
    EXPECT_EQ(posts(), before + 130);
    const auto lines = processLog.messages("ops");
    EXPECT_EQ(std::count_if(lines.begin(), lines.end(),
                            [](const auto& line) { return line.ends_with(" for dead client pid 77"); }),
              130);
    ASSERT_EQ(daemon.server->holds().size(), 1U);
    EXPECT_EQ(daemon.server->holds().front()->uuid(), kept);
    daemon.server->unholdToken(kept);
    EXPECT_FALSE(isHeld(0));
}

} // namespace
