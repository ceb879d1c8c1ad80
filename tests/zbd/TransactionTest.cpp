#include "zbd/Transaction.h"
#include "tests/support/FakeDaemon.h"
#include "zbd/ZBDQmxClient.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::dataPlugIn;
using support::errorReply;
using support::logged;
using Names = std::vector<std::string>;

struct Transaction : testing::Test {
    support::FakeDaemon daemon;
    support::FakeRegistry& registry = daemon.fake.registry;
    const Dictionary succeeded;

    /// The form that a find for `message` answers.
    Dictionary find(MutableDictionary message) {
        const auto reply = daemon.ask("find", std::move(message));
        const auto bytes = reply["matches"].data();
        EXPECT_TRUE(bytes) << Value(reply).description();
        return bytes ? *decodeCompact(*bytes, UUIDs::refused)->dictionary() : Dictionary();
    }
};

TEST_F(Transaction, VersionIsJudgedFirstThenTheType) {
    const auto connection = daemon.connect();
    const auto ask = [&](const Dictionary& message) { return *daemon.ask(connection, message); };
    for (const auto& [version, shown] :
         {std::pair<Value, std::string>{1, "1"}, {4, "4"}, {0, "0"}, {"3", "0"}, {-3, "0"}, {Value(), "0"}}) {
        MutableDictionary message{{"request", "bulk"}};
        if (version) message.set("version", version);
        EXPECT_EQ(ask(message), errorReply(7, "unsupported protocol version " + shown + " (current 3)"));
    }
    for (const int version : {2, 3}) EXPECT_EQ(ask({{"request", "bulk"}, {"version", version}}), succeeded);
    EXPECT_EQ(ask({{"version", 3}}), errorReply(4, "invalid request format (missing type)"));
    EXPECT_EQ(ask({{"version", 3}, {"request", 5}}), errorReply(4, "invalid request format (missing type)"));
    EXPECT_EQ(ask({{"version", 3}, {"request", "Bulk"}}), errorReply(4, "unrecognized request"));
    EXPECT_TRUE(logged(LogLevel::debug, "client 77 requested Bulk"));
}

TEST_F(Transaction, PathWalkStopsAtTheFirstBadElement) {
    for (const char* directory : {"/real", "/also"}) daemon.fake.files.addDirectory(directory);
    daemon.fake.files.links["/link"] = "/real";
    registry.allowRegistration();
    Names registered;
    registry.onRegister([&](const URL& url) { registered.push_back(url.path()); });
    const Dictionary malformed = errorReply(4, "invalid request format");
    const struct {
        Value paths;
        Dictionary reply;
        Names registered; // what came before a bad element stays
    } cases[] = {
        {Value(), malformed, {}},
        {"/real", malformed, {}},
        {Array(), succeeded, {}},
        {Array{"/link", "/also"}, succeeded, {"/real", "/also"}},
        {Array{"/real", 7, "/also"}, malformed, {"/real"}},
        {Array{"/real", "rel/ative", "/also"}, errorReply(9, "absolute path required: rel/ative"), {"/real"}},
        {Array{"/real", "/missing", "/also"}, errorReply(9, "invalid plugin path: /missing"), {"/real"}},
    };
    for (const auto& c : cases) {
        registered.clear();
        EXPECT_EQ(daemon.ask("add", c.paths ? MutableDictionary{{"paths", c.paths}} : MutableDictionary()), c.reply);
        EXPECT_EQ(registered, c.registered) << c.paths.description();
    }
}

TEST_F(Transaction, AddGoesAsFarAsTheClientsUserAndTheRegistryMay) {
    for (const char* directory : {"/real", "/closed"}) daemon.fake.files.addDirectory(directory);
    const auto add = [&](const Array& paths) { return daemon.ask("add", {{"paths", paths}}); };
    registry.allowRegistration();
    registry.close("/closed");
    EXPECT_EQ(add({"/real", "/closed"}), errorReply(2, "unable to register plug-in at /closed"));
    EXPECT_EQ(registry.calls("registerPlugIn"), 1);
    registry.before("registerPlugIn", [&] { registry.allowRegistration(false); });
    EXPECT_EQ(add({"/real"}), errorReply(2, "unable to register plug-in at /real"));
    EXPECT_TRUE(logged(LogLevel::standard, "failed to register plug-in at /real"));
    daemon.peer.uid = 1;
    daemon.fake.transport.setPeer(daemon.peer);
    EXPECT_EQ(add({"/real"}), errorReply(9, "invalid plugin path: /real"));
}

TEST_F(Transaction, RequestsOfAllClientsAreServedWholeInTheOrderTheyCame) {
    auto& fake = daemon.fake;
    registry.allowRegistration();
    fake.files.addDirectory("/real");
    const auto client = daemon.connect();
    const auto other = daemon.connect();
    fake.queues.setMode(support::FakeWorkQueues::Mode::manual);
    Names answered;
    const auto send = [&](const auto& from, const std::string& type, const Array& paths) {
        from->sendWithReply(Dictionary{{"request", type}, {"version", 3}, {"paths", paths}},
                            fake.queues.makeSerial("replies"), [&answered, type](const ReplyOrError& reply) {
                                if (std::holds_alternative<Dictionary>(reply)) answered.push_back(type);
                            });
    };
    const auto addAndOthers = [&] {
        registry.resetCalls();
        answered.clear();
        send(client, "add", Array::of(Names(100, "/real")));
        send(other, "find", {});
        send(client, "bulk", {});
        while (fake.transport.deliver() > 0 || fake.queues.runOne()) {
        }
        EXPECT_EQ(registry.calls("registerPlugIn"), 100);
        return answered;
    };
    EXPECT_EQ(addAndOthers(), (Names{"add", "find", "bulk"}));
    registry.onRegister([&](const URL&) { client->cancel(); });
    EXPECT_EQ(addAndOthers(), Names{"find"}) << "what was begun is finished";
}

TEST_F(Transaction, RemoveNeedsTheManagerEntitlement) {
    registry.allowRegistration();
    Names removed;
    registry.onUnregister([&](const URL& url) { removed.push_back(url.path()); });
    const auto remove = [&](const Array& paths) { return daemon.ask("remove", {{"paths", paths}}); };
    const Array paths{"/missing", "/other"};
    EXPECT_EQ(remove(paths), errorReply(11, "caller lacks entitlement for this operation"));
    EXPECT_TRUE(logged(LogLevel::standard,
                       "refused request from pid=77 to remove plug-in at /missing - client lacks required entitlement",
                       ""));
    EXPECT_TRUE(removed.empty());
    EXPECT_EQ(remove({}), succeeded);

    daemon.fake.codeSigning.entitlements[77] = Dictionary{{"com.nordane.private.zembra.manager", true}};
    EXPECT_EQ(remove(paths), succeeded);
    EXPECT_EQ(removed, (Names{"/missing", "/other"})) << "unresolved paths are passed on";
    registry.allowRegistration(false);
    EXPECT_EQ(remove(paths), errorReply(9, "no plugin at /missing"));
}

TEST_F(Transaction, BulkIsLoggedAndSucceeds) {
    EXPECT_EQ(daemon.ask("bulk"), succeeded);
    EXPECT_TRUE(logged(LogLevel::info, "bulk options 0x0 not supported"));
    EXPECT_EQ(daemon.ask("bulk", {{"flags", 0x1f}}), succeeded);
    EXPECT_TRUE(logged(LogLevel::info, "bulk options 0x1f not supported"));
}

TEST_F(Transaction, FindByUUIDAndByLocation) {
    const auto a = registry.install(dataPlugIn("a"));
    const auto b = registry.install(dataPlugIn("b"));
    const Value locationOfB = b->bundleURL->absoluteString();
    EXPECT_EQ(find({{"uuids", *a->uuid}})["identifier"], Value("com.example.a"));
    EXPECT_EQ(find({{"paths", locationOfB}})["identifier"], Value("com.example.b"));
    EXPECT_EQ(find({{"uuids", *a->uuid}, {"paths", locationOfB}})["identifier"], Value("com.example.b"));

    for (const MutableDictionary& message :
         {MutableDictionary{}, MutableDictionary{{"uuids", *a->uuid}, {"paths", "file:///nowhere"}},
          MutableDictionary{{"uuids", Array{*a->uuid}}}, MutableDictionary{{"uuids", a->uuid->text()}},
          MutableDictionary{{"paths", a->bundleURL->path()}}, MutableDictionary{{"paths", "%zz"}}}) {
        EXPECT_EQ(daemon.ask("find", message), errorReply(15, "Cannot locate PlugIn")) << Value(message).description();
    }
    EXPECT_TRUE(logged(LogLevel::standard, "plugin not found"));
    EXPECT_EQ(daemon.ask(daemon.connect(), {{"request", "find"}, {"version", 2}, {"uuids", *a->uuid}}), succeeded)
        << "forms travel in version 3 only";
}

TEST_F(Transaction, FindCompletesTheForm) {
    const auto a = daemon.plugIn("a");
    const MutableDictionary message{{"uuids", *a->uuid()}};
    EXPECT_EQ(find(message)["annotations"], Value(Dictionary()));
    daemon.server->setAnnotation(Dictionary{{"election", 1}}, *a);
    EXPECT_EQ(find(message)["annotations"], Value(Dictionary{{"election", 1}}));
    EXPECT_TRUE(logged(LogLevel::standard, "plugin found " + a->description()));

    // One that vanished, but is cached, is sent as far as it is known.
    registry.uninstall(*a->uuid());
    const auto form = find(message);
    EXPECT_EQ(form["identifier"], Value("com.example.a"));
    EXPECT_FALSE(form.contains("bundleInfo"));
    EXPECT_TRUE(logged(LogLevel::error, "failed to export matching plug-in " + a->uuid()->text() + ": "));
}

/// The walk over "uuids", called as handlers do.
struct UUIDWalk : Transaction {
    Names walked;

    /// The reply's error when the walk failed; an empty dictionary when every plug-in was visited.
    Dictionary walk(MutableDictionary message, std::size_t stopAfter = 100) {
        walked.clear();
        const auto [host, accepted] =
            daemon.fake.transport.makePair(daemon.peer, daemon.fake.queues.makeSerial("host"));
        const auto client = zbd::ZBDQmxClient::initWithConnection(accepted, daemon.server);
        const auto transaction = zbd::Transaction::initWithRequest({message, nullptr}, client);
        const bool isComplete = transaction->processUuidList([&](const zbd::ZBDPlugInRef& plugIn) {
            walked.emplace_back(*plugIn->identifier().string());
            return walked.size() < stopAfter;
        });
        EXPECT_EQ(isComplete, transaction->reply().empty() && walked.size() < stopAfter);
        return transaction->reply();
    }
};

TEST_F(UUIDWalk, VisitsPlugInsByUUIDOrElseByPathAndAnswersWhatItCannotWalk) {
    const UUID a = *registry.install(dataPlugIn("a"))->uuid;
    const auto proxyOfB = registry.install(dataPlugIn("b"));
    const UUID b = *proxyOfB->uuid;
    const UUID unknown = UUID::random();
    const std::string path = proxyOfB->bundleURL->path();
    const Names both{"com.example.a", "com.example.b"};
    const Names first{"com.example.a"};
    const Dictionary noList = errorReply(4, "invalid request format (uuid)");
    const Dictionary badElement = errorReply(4, "invalid request (bad uuid array)");
    const Dictionary notFound = errorReply(4, "no such plugin (uuid not found)");
    const struct {
        MutableDictionary message;
        Dictionary reply;
        Names walked;
    } cases[] = {
        {{{"uuids", Array{a, b}}}, succeeded, both},
        {{{"uuids", Array()}}, succeeded, {}},
        {{{"uuids", Array{a, unknown}}, {"paths", Array{"/nowhere", path}}}, succeeded, both},
        {{}, noList, {}},
        {{{"uuids", a}}, noList, {}},
        {{{"uuids", Array{a, a.text()}}}, badElement, first},
        {{{"uuids", Array{a, unknown, a}}}, notFound, first},
        {{{"uuids", Array{unknown}}, {"paths", Array{7}}}, notFound, {}},
        {{{"uuids", Array{unknown}}, {"paths", Array{"/nowhere"}}}, notFound, {}},
        {{{"uuids", Array{unknown}}, {"paths", path}}, notFound, {}},
        {{{"uuids", Array{unknown, unknown}}, {"paths", Array{path}}}, notFound, {}},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(walk(c.message), c.reply) << Value(c.message).description();
        EXPECT_EQ(walked, c.walked);
    }
    const auto told = [](LogLevel level, const std::string& text) { return logged(level, text, "traffic"); };
    EXPECT_TRUE(told(LogLevel::info, "Failed to find plugin by " + unknown.text()));
    EXPECT_TRUE(told(LogLevel::info, "Looking for plugin " + unknown.text() + " by path " + path));
    EXPECT_TRUE(told(LogLevel::standard, "Paths present but not an array (ignoring values)"));
    EXPECT_TRUE(told(LogLevel::standard, "Paths present but has different count than UUIDs (ignoring)"));

    walk({{"uuids", Array{a, b}}}, 1);
    EXPECT_EQ(walked, first) << "the callback may stop it";
}

} // namespace
