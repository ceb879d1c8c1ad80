#include "zbd/Transaction.h"
#include "Zembra/ZBDaemonClient.h"
#include "tests/support/FakeDaemon.h"
#include "zbd/ZBDQmxClient.h"

#include <gtest/gtest.h>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::LogLevel;
using platform::MutableDictionary;
using platform::UUID;
using platform::Value;
using support::dataPlugIn;
using support::errorReply;
using support::processLog;

struct Transaction : testing::Test {
    support::FakeDaemon daemon;
    const Dictionary succeeded;

    void grant(std::string_view entitlement, const Value& value = true) {
        daemon.fake.codeSigning.entitlements[77] = Dictionary{{entitlement, value}};
    }
    static Dictionary formOf(const Dictionary& reply) {
        const auto bytes = reply["matches"].data();
        EXPECT_TRUE(bytes) << Value(reply).description();
        return bytes ? *platform::decodeCompact(*bytes, platform::UUIDs::refused)->dictionary() : Dictionary();
    }
};

TEST_F(Transaction, VersionIsJudgedFirst) {
    const auto connection = daemon.connect();
    const auto ask = [&](const Dictionary& message) { return *daemon.ask(connection, message); };
    for (const auto& [version, shown] :
         {std::pair<Value, std::string>{1, "1"}, {4, "4"}, {0, "0"}, {"3", "0"}, {-3, "0"}}) {
        EXPECT_EQ(ask({{"request", "bulk"}, {"version", version}}),
                  errorReply(7, "unsupported protocol version " + shown + " (current 3)"));
    }
    EXPECT_EQ(ask({}), errorReply(7, "unsupported protocol version 0 (current 3)"));
    for (const int version : {2, 3}) EXPECT_EQ(ask({{"request", "bulk"}, {"version", version}}), succeeded);
}

TEST_F(Transaction, TypesAreExactStrings) {
    const auto connection = daemon.connect();
    EXPECT_EQ(*daemon.ask(connection, {{"version", 3}}), errorReply(4, "invalid request format (missing type)"));
    EXPECT_EQ(*daemon.ask(connection, {{"version", 3}, {"request", 5}}),
              errorReply(4, "invalid request format (missing type)"));
    EXPECT_EQ(daemon.ask("Bulk"), errorReply(4, "unrecognized request"));
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "ops", "client 77 requested Bulk"));
}

TEST_F(Transaction, PathWalkStopsAtTheFirstBadElement) {
    auto& fake = daemon.fake;
    fake.registry.allowRegistration();
    std::vector<std::string> registered;
    fake.registry.onRegister([&](const platform::URL& url) { registered.push_back(url.path()); });
    fake.files.addDirectory("/real");
    fake.files.addDirectory("/also");
    fake.files.links["/link"] = "/real";
    const auto add = [&](const Value& paths) {
        registered.clear();
        MutableDictionary message;
        if (paths) message.set("paths", paths);
        return daemon.ask("add", message);
    };
    using Paths = std::vector<std::string>;
    EXPECT_EQ(add(Value()), errorReply(4, "invalid request format"));
    EXPECT_EQ(add("/real"), errorReply(4, "invalid request format"));
    EXPECT_EQ(add(Array()), succeeded);
    EXPECT_EQ(add(Array{"/link", "/also"}), succeeded);
    EXPECT_EQ(registered, (Paths{"/real", "/also"})) << "symbolic links are resolved";
    EXPECT_EQ(add(Array{"/real", 7, "/also"}), errorReply(4, "invalid request format"));
    EXPECT_EQ(registered, (Paths{"/real"})) << "what came before stays";
    EXPECT_EQ(add(Array{"/real", "rel/ative", "/also"}), errorReply(9, "absolute path required: rel/ative"));
    EXPECT_EQ(registered, (Paths{"/real"}));
    EXPECT_EQ(add(Array{"/real", "/missing", "/also"}), errorReply(9, "invalid plugin path: /missing"));
    EXPECT_EQ(registered, (Paths{"/real"}));
}

TEST_F(Transaction, AddReportsTheRegistrysRefusalInItsOwnWords) {
    daemon.fake.files.addDirectory("/real");
    EXPECT_EQ(daemon.ask("add", {{"paths", Array{"/real"}}}), errorReply(2, "unable to register plug-in at /real"));
    EXPECT_TRUE(processLog.contains(LogLevel::standard, "ops", "failed to register plug-in at /real"));
}

TEST_F(Transaction, RemoveNeedsTheManagerEntitlement) {
    auto& fake = daemon.fake;
    fake.registry.allowRegistration();
    std::vector<std::string> removed;
    fake.registry.onUnregister([&](const platform::URL& url) { removed.push_back(url.path()); });
    const Dictionary refused = errorReply(11, "caller lacks entitlement for this operation");
    const MutableDictionary message{{"paths", Array{"/missing", "/other"}}};
    EXPECT_EQ(daemon.ask("remove", message), refused);
    EXPECT_TRUE(processLog.contains(LogLevel::standard, "",
                                    "refused request from pid=77 to remove plug-in at /missing - client lacks required "
                                    "entitlement"));
    EXPECT_TRUE(removed.empty());
    EXPECT_EQ(daemon.ask("remove", {{"paths", Array()}}), succeeded);

    grant("com.nordane.private.zembra.manager");
    EXPECT_EQ(daemon.ask("remove", message), succeeded);
    EXPECT_EQ(removed, (std::vector<std::string>{"/missing", "/other"})) << "unresolved paths are passed on";
    fake.registry.allowRegistration(false);
    EXPECT_EQ(daemon.ask("remove", message), errorReply(9, "no plugin at /missing"));
}

TEST_F(Transaction, BulkIsLoggedAndSucceeds) {
    EXPECT_EQ(daemon.ask("bulk"), succeeded);
    EXPECT_EQ(daemon.ask("bulk", {{"flags", 0x1f}}), succeeded);
    EXPECT_TRUE(processLog.contains(LogLevel::info, "ops", "bulk options 0x0 not supported"));
    EXPECT_TRUE(processLog.contains(LogLevel::info, "ops", "bulk options 0x1f not supported"));
}

TEST_F(Transaction, FindByUUIDAndByLocation) {
    const auto a = daemon.fake.registry.install(dataPlugIn("a"));
    const auto b = daemon.fake.registry.install(dataPlugIn("b"));
    const auto url = [](const auto& proxy) { return Value(proxy->bundleURL->absoluteString()); };
    const auto find = [&](MutableDictionary message) { return daemon.ask("find", std::move(message)); };
    EXPECT_EQ(formOf(find({{"uuids", *a->uuid}}))["identifier"], Value("com.example.a"));
    EXPECT_EQ(formOf(find({{"paths", url(b)}}))["identifier"], Value("com.example.b"));
    EXPECT_EQ(formOf(find({{"uuids", *a->uuid}, {"paths", url(b)}}))["identifier"], Value("com.example.b"));

    const Dictionary lost = errorReply(15, "Cannot locate PlugIn");
    for (const MutableDictionary& message :
         {MutableDictionary{}, MutableDictionary{{"uuids", *a->uuid}, {"paths", "file:///nowhere"}},
          MutableDictionary{{"uuids", Array{*a->uuid}}}, MutableDictionary{{"uuids", a->uuid->text()}},
          MutableDictionary{{"paths", a->bundleURL->path()}}, MutableDictionary{{"paths", "%zz"}}}) {
        EXPECT_EQ(find(message), lost) << Value(message).description();
    }
    EXPECT_TRUE(processLog.contains(LogLevel::standard, "ops", "plugin not found"));
}

TEST_F(Transaction, FindCompletesTheForm) {
    const auto a = daemon.fake.registry.install(dataPlugIn("a"));
    const auto record = daemon.server->findPlugIn(*a->uuid);
    EXPECT_EQ(formOf(daemon.ask("find", {{"uuids", *a->uuid}}))["annotations"], Value(Dictionary()));
    daemon.server->setAnnotation(Dictionary{{"election", 1}}, *record);
    EXPECT_EQ(formOf(daemon.ask("find", {{"uuids", *a->uuid}}))["annotations"], Value(Dictionary{{"election", 1}}));
    EXPECT_TRUE(processLog.contains(LogLevel::standard, "ops", "plugin found " + record->description()));
}

TEST_F(Transaction, FindOfVersionTwoSucceedsWithoutAForm) {
    const auto a = daemon.fake.registry.install(dataPlugIn("a"));
    EXPECT_EQ(daemon.ask(daemon.connect(), {{"request", "find"}, {"version", 2}, {"uuids", *a->uuid}}), Dictionary());
}

TEST_F(Transaction, FindOfAVanishedPlugInLogsAndSendsWhatThereIs) {
    const auto a = daemon.fake.registry.install(dataPlugIn("a"));
    daemon.server->findPlugIn(*a->uuid); // cached
    daemon.fake.registry.uninstall(*a->uuid);
    const auto form = formOf(daemon.ask("find", {{"uuids", *a->uuid}}));
    EXPECT_EQ(form["identifier"], Value("com.example.a"));
    EXPECT_FALSE(form.contains("bundleInfo"));
    bool isLogged = false;
    for (const auto& line : processLog.lines()) {
        isLogged =
            isLogged || (line.level == LogLevel::error && line.category == "ops" &&
                         line.message.starts_with("failed to export matching plug-in " + a->uuid->text() + ": "));
    }
    EXPECT_TRUE(isLogged);
}

/// The walk over "uuids" has no request of its own yet, so it is called as a handler would.
struct UUIDWalk : Transaction {
    std::vector<std::string> walked;

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
    static bool logged(LogLevel level, const std::string& text) { return processLog.contains(level, "traffic", text); }
};

TEST_F(UUIDWalk, VisitsPlugInsByUUIDOrElseByPath) {
    const auto a = daemon.fake.registry.install(dataPlugIn("a"));
    const auto b = daemon.fake.registry.install(dataPlugIn("b"));
    const UUID unknown = UUID::random();
    const std::string path = b->bundleURL->path();
    using Names = std::vector<std::string>;

    EXPECT_EQ(walk({{"uuids", Array{*a->uuid, *b->uuid}}}), succeeded);
    EXPECT_EQ(walked, (Names{"com.example.a", "com.example.b"}));
    EXPECT_EQ(walk({{"uuids", Array()}}), succeeded);
    EXPECT_EQ(walk({{"uuids", Array{*a->uuid, unknown}}, {"paths", Array{"/nowhere", path}}}), succeeded);
    EXPECT_EQ(walked, (Names{"com.example.a", "com.example.b"}));
    EXPECT_TRUE(logged(LogLevel::info, "Failed to find plugin by " + unknown.text()));
    EXPECT_TRUE(logged(LogLevel::info, "Looking for plugin " + unknown.text() + " by path " + path));

    walk({{"uuids", Array{*a->uuid, *b->uuid}}}, 1);
    EXPECT_EQ(walked, (Names{"com.example.a"})) << "the callback may stop it";
}

TEST_F(UUIDWalk, AnswersWhatItCannotWalk) {
    const auto a = daemon.fake.registry.install(dataPlugIn("a"));
    const UUID unknown = UUID::random();
    const Dictionary noList = errorReply(4, "invalid request format (uuid)");
    const Dictionary badElement = errorReply(4, "invalid request (bad uuid array)");
    const Dictionary notFound = errorReply(4, "no such plugin (uuid not found)");
    const struct {
        MutableDictionary message;
        Dictionary reply;
        std::size_t walked;
    } cases[] = {
        {{}, noList, 0},
        {{{"uuids", *a->uuid}}, noList, 0},
        {{{"uuids", Array{*a->uuid, a->uuid->text()}}}, badElement, 1},
        {{{"uuids", Array{*a->uuid, unknown, *a->uuid}}}, notFound, 1},
        {{{"uuids", Array{unknown}}, {"paths", Array{7}}}, notFound, 0},
        {{{"uuids", Array{unknown}}, {"paths", Array{"/nowhere"}}}, notFound, 0},
        {{{"uuids", Array{unknown}}, {"paths", a->bundleURL->path()}}, notFound, 0},
        {{{"uuids", Array{unknown, unknown}}, {"paths", Array{a->bundleURL->path()}}}, notFound, 0},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(walk(c.message), c.reply) << Value(c.message).description();
        EXPECT_EQ(walked.size(), c.walked);
    }
    EXPECT_TRUE(logged(LogLevel::standard, "Paths present but not an array (ignoring values)"));
    EXPECT_TRUE(logged(LogLevel::standard, "Paths present but has different count than UUIDs (ignoring)"));
}

} // namespace
