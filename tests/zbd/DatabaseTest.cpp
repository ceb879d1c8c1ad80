#include "tests/support/FakeDaemon.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::dataPlugIn;
using support::logged;
using support::processLog;

const Dictionary autoElect{{"com.nordane.developer.auto-elect-plugin", true}};

struct Database : testing::Test {
    support::FakeDaemon daemon;
    support::FakePlatform& fake = daemon.fake;
    zbd::ZBDatabase& database = *daemon.server;

    void annotate(const PlugInProxyRef& proxy, const Dictionary& annotation) {
        database.setAnnotation(annotation, *zbd::ZBDPlugIn::initWithCXData(fake.platform, proxy));
    }
    /// How many records were built.
    static long builds() {
        const auto messages = processLog.messages("ops");
        return std::count(messages.begin(), messages.end(), "createPlugInForProxy");
    }
    std::set<std::string> found(const std::optional<Dictionary>& query) {
        std::set<std::string> names;
        const auto plugIns = database.findPlugIns(query).value_or(std::vector<zbd::ZBDPlugInRef>());
        for (const auto& plugIn : plugIns) names.emplace(plugIn->identifier().string()->substr(12)); // "com.example."
        return names;
    }
};

TEST_F(Database, RecordIsBuiltOnceAndFoundByEveryWay) {
    const auto proxy = fake.install("a");
    const auto plugIn = database.findPlugIn(*proxy->uuid);
    fake.registry.fireDidInstall({proxy}); // leaves the cache alone
    EXPECT_EQ(database.findPlugInAtPath(*proxy->bundleURL), plugIn);
    EXPECT_EQ(database.plugInForProxy(proxy), plugIn);
    EXPECT_EQ(database.findPlugIns(std::nullopt), std::vector{plugIn});
    EXPECT_EQ(builds(), 1);
    EXPECT_TRUE(logged(LogLevel::standard, "plug-in INSTALLED:com.example.a com.example.a(1) " + proxy->uuid->text() +
                                               " " + proxy->bundleURL->path()));
    const auto unknown = UUID::random();
    EXPECT_FALSE(database.findPlugIn(unknown));
    EXPECT_TRUE(logged(LogLevel::info, "Catalix cannot find plug-in with UUID:" + unknown.text()));
    EXPECT_FALSE(database.findPlugInAtPath(URL::file("/nowhere")));
    EXPECT_TRUE(logged(LogLevel::info, "Catalix cannot find plug-in at path:/nowhere"));
    // The registry refuses.
    const URL url = *proxy->bundleURL;
    EXPECT_EQ(database.addPlugIn(url), (Error{"Zembra", 2, "Catalix failed to register the plug-in"}));
    EXPECT_EQ(database.removePlugIn(url), (Error{"Zembra", 2, "Catalix failed to deregister the plug-in"}));
}

TEST_F(Database, CacheIsPurgedWholeWhenItOutgrowsItsLimit) {
    database.setCacheLimit(2);
    std::vector<PlugInProxyRef> proxies;
    for (const char* name : {"a", "b", "c", "d"}) proxies.push_back(fake.install(name));
    // Three records fit, for the test before the third sees two; the fourth finds three.
    for (const auto& [index, built] : {std::pair(0U, 1), {1U, 2}, {2U, 3}, {0U, 3}, {3U, 4}, {3U, 4}, {0U, 5}}) {
        database.findPlugIn(*proxies[index]->uuid);
        EXPECT_EQ(builds(), built) << index;
        EXPECT_EQ(fake.registry.calls("clearSchemaCaches"), built > 3 ? 1 : 0);
    }
    EXPECT_TRUE(logged(LogLevel::info, "purging cache for 3 > 2"));
    fake.locale.setLanguages({"de", "en"});
    fake.queues.runAll();
    EXPECT_EQ(fake.registry.calls("clearSchemaCaches"), 2) << "a change of locale empties it too";
    EXPECT_TRUE(logged(LogLevel::standard, "locale change detected; purging cache"));
}

TEST_F(Database, UninstallNoticeRemovesThenTellsTheDelegate) {
    struct Delegate : zbd::ZBDatabaseDelegate {
        std::function<void()> told;
        void removedPlugIns(const std::vector<PlugInProxyRef>&) override { told(); }
    };
    const auto delegate = std::make_shared<Delegate>();
    database.setDelegate(delegate);
    const auto proxy = fake.install("a");
    EXPECT_TRUE(database.findPlugIn(*proxy->uuid));
    fake.registry.uninstall(*proxy->uuid);
    int removals = 0;
    delegate->told = [&] { removals += database.findPlugIn(*proxy->uuid) ? 0 : 1; }; // it may use the database
    fake.registry.fireWillUninstall({proxy});
    EXPECT_EQ(removals, 1);
}

TEST_F(Database, ProxyOlderThanItsUninstallGivesNoRecord) {
    const auto outdated = fake.install("a"); // a discovery may have taken it before
    fake.registry.uninstall(*outdated->uuid);
    EXPECT_FALSE(database.plugInForProxy(outdated));
}

TEST_F(Database, UnusablePlugInsAreSkipped) {
    const URL url = URL::file("/Applications/A.app");
    for (const auto& [name, application] : {std::pair("good", ApplicationRecord{url, {}, {}}),
                                            {"misconfigured", {url, {}, {}}},
                                            {"placeholder", {URL::file("/P.app"), {}, {}, true, true}},
                                            {"strange", {URL::file("/S"), {}, {}, false, false}}}) {
        auto described = dataPlugIn(name);
        described.containingBundle = std::make_shared<ApplicationRecord>(application);
        if (name == std::string("misconfigured")) described.info = support::manifestOf("com.example.bad", {});
        fake.registry.install(described);
    }
    auto unplaced = *fake.install("unplaced");
    unplaced.bundleURL.reset();
    fake.registry.install(unplaced);

    EXPECT_EQ(found(std::nullopt), (std::set<std::string>{"good"}));
    EXPECT_EQ(database.plugInsWithinApplication(url)->size(), 1U);
    EXPECT_EQ(builds(), 3) << "the misconfigured one is tried each time";
    const std::string log = testing::PrintToString(processLog.messages("ops"));
    for (const char* text :
         {" with nil bundleURL\"", " because its app is a placeholder\"",
          "CX reported containingBundle is not an application", "CX reported 1 plug-ins (cache 0/1)"})
        EXPECT_NE(log.find(text), std::string::npos) << text;
}

TEST_F(Database, ElectionPrefilterKeepsWhatTheRuleAsksFor) {
    fake.install("none");
    fake.install("automatic", autoElect);
    fake.install("falsely", Dictionary{{"com.nordane.developer.auto-elect-plugin", "yes"}});
    annotate(fake.install("elected"), {{"election", 1}});
    annotate(fake.install("wide"), {{"election", 257}});
    fake.install("replacing", Dictionary{{"com.nordane.developer.replace-plugin", "com.example.elected"}});
    const std::set<std::string> all{"automatic", "elected", "wide", "replacing", "none", "falsely"};
    const std::pair<std::vector<Value>, std::set<std::string>> cases[] = {
        {{"1", "=1", Array{"1", "=2"}}, {"automatic", "elected", "wide", "replacing"}},
        {{"0"}, {"none", "falsely"}},
        {{"7", Array(), "="}, {}},
        {{Array{"0", "1"}}, all},
        // These build no prefilter, so the registry's whole answer stays.
        {{"<>1", "", Array{"1", "!1"}, Array{"1", 2}, 1, true}, all}};
    for (const auto& [patterns, expected] : cases)
        for (const Value& pattern : patterns)
            EXPECT_EQ(found(Dictionary{{"VKUserElection", pattern}}), expected) << pattern.description();
    EXPECT_EQ(found(Dictionary{{"other", "1"}}), all);
    fake.registry.answerNothing();
    EXPECT_FALSE(database.findPlugIns(autoElect));
}

TEST_F(Database, AutoElectionHappensWhenTheRecordIsBuilt) {
    for (const auto& [before, after] : {std::pair(0, 1), {2, 2}}) {
        const auto proxy = fake.install("a" + std::to_string(before), autoElect);
        annotate(proxy, {{"election", before}, {"extension", Dictionary()}});
        EXPECT_EQ(database.annotationForPlugIn(*database.findPlugIn(*proxy->uuid)),
                  (Dictionary{{"election", after}, {"extension", Dictionary()}}));
    }
    EXPECT_TRUE(fake.notifications.posts().empty());
}

} // namespace
