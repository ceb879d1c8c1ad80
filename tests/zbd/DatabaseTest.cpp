#include "tests/support/FakePlatform.h"
#include "zbd/ZBDatabase.h"

#include <gtest/gtest.h>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::LogLevel;
using platform::PlugInProxyRef;
using platform::URL;
using platform::UUID;
using platform::Value;
using support::dataPlugIn;
using support::processLog;

class TestDatabase : public zbd::ZBDatabase {
public:
    explicit TestDatabase(platform::Platform& platform) : ZBDatabase(platform) {}
};

struct Listener : zbd::ZBDatabaseDelegate {
    std::vector<std::size_t> removed;
    std::function<void()> then;
    void removedPlugIns(const std::vector<PlugInProxyRef>& proxies) override {
        removed.push_back(proxies.size());
        if (then) then();
    }
};

struct Database : testing::Test {
    support::FakePlatform fake;
    std::shared_ptr<TestDatabase> database = std::make_shared<TestDatabase>(fake.platform);

    void SetUp() override {
        ASSERT_TRUE(database->initWithDatabase(std::nullopt));
        processLog.clear();
    }
    PlugInProxyRef install(const std::string& name, std::optional<Dictionary> entitlements = {}) {
        auto described = dataPlugIn(name);
        described.entitlements = std::move(entitlements);
        return fake.registry.install(described);
    }
    /// How many records were built since the log was cleared.
    static long builds() {
        const auto messages = processLog.messages("ops");
        return std::count(messages.begin(), messages.end(), "createPlugInForProxy");
    }
    std::set<std::string> found(const std::optional<Dictionary>& query) {
        std::set<std::string> identifiers;
        const auto plugIns = database->findPlugIns(query);
        EXPECT_TRUE(plugIns);
        for (const auto& plugIn : *plugIns) identifiers.emplace(*plugIn->identifier().string());
        return identifiers;
    }
};

TEST_F(Database, QueueIsNamed) {
    const auto made = [&](std::string_view label) {
        return std::any_of(fake.queues.made.begin(), fake.queues.made.end(),
                           [&](const auto& m) { return m.label == label; });
    };
    EXPECT_TRUE(made("ZBDatabase"));
}

TEST_F(Database, RecordIsBuiltOnceAndFoundByEveryWay) {
    const auto proxy = install("a");
    const auto plugIn = database->findPlugIn(*proxy->uuid);
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(database->findPlugInAtPath(*proxy->bundleURL), plugIn);
    EXPECT_EQ(database->plugInForProxy(proxy), plugIn);
    EXPECT_TRUE(database->findPlugIns(std::nullopt)->contains(plugIn));
    EXPECT_EQ(builds(), 1);
}

TEST_F(Database, UnknownPlugInsAreLogged) {
    const auto unknown = UUID::random();
    EXPECT_FALSE(database->findPlugIn(unknown));
    EXPECT_TRUE(processLog.contains(LogLevel::info, "ops", "Catalix cannot find plug-in with UUID:" + unknown.text()));
    EXPECT_FALSE(database->findPlugInAtPath(URL::file("/nowhere")));
    EXPECT_TRUE(processLog.contains(LogLevel::info, "ops", "Catalix cannot find plug-in at path:/nowhere"));
}

TEST_F(Database, UnusableProxyIsTriedAgainEachTime) {
    auto described = dataPlugIn("bad");
    described.path = "/elsewhere/bad.plugin";
    const auto proxy = fake.registry.install(described);
    EXPECT_FALSE(database->findPlugIn(*proxy->uuid));
    EXPECT_FALSE(database->findPlugIn(*proxy->uuid));
    EXPECT_EQ(builds(), 2);
    EXPECT_TRUE(found(std::nullopt).empty());
}

TEST_F(Database, CacheIsPurgedWholeWhenItOutgrowsItsLimit) {
    database->setCacheLimit(2);
    const auto first = install("a");
    for (const char* name : {"b", "c", "d"}) install(name);
    const auto proxies = *fake.registry.installedPlugIns();
    const auto build = [&](std::size_t i) { return database->findPlugIn(*proxies[i]->uuid); };
    for (std::size_t i = 0; i < 3; ++i) build(i);
    EXPECT_EQ(builds(), 3);
    for (std::size_t i = 0; i < 3; ++i) build(i);
    EXPECT_EQ(builds(), 3) << "three records fit: the test before the third saw two";
    EXPECT_EQ(fake.registry.calls("clearSchemaCaches"), 0);
    build(3);
    EXPECT_TRUE(processLog.contains(LogLevel::info, "ops", "purging cache for 3 > 2"));
    EXPECT_EQ(fake.registry.calls("clearSchemaCaches"), 1);
    build(3);
    EXPECT_EQ(builds(), 4);
    build(0);
    EXPECT_EQ(builds(), 5);
}

TEST_F(Database, LocaleChangeEmptiesTheCache) {
    const auto proxy = install("a");
    database->findPlugIn(*proxy->uuid);
    fake.locale.setLanguages({"de", "en"});
    fake.queues.runAll();
    EXPECT_TRUE(processLog.contains(LogLevel::standard, "ops", "locale change detected; purging cache"));
    database->findPlugIn(*proxy->uuid);
    EXPECT_EQ(builds(), 2);
}

TEST_F(Database, InstallNoticeLeavesTheCacheAlone) {
    const auto proxy = install("a");
    const auto before = database->findPlugIn(*proxy->uuid);
    fake.registry.fireDidInstall({proxy});
    EXPECT_EQ(database->findPlugIn(*proxy->uuid), before);
    EXPECT_TRUE(processLog.contains(LogLevel::standard, "ops",
                                    "plug-in INSTALLED:com.example.a com.example.a(1) " + proxy->uuid->text() + " " +
                                        proxy->bundleURL->path()));
}

TEST_F(Database, UninstallNoticeRemovesThenTellsTheDelegate) {
    const auto listener = std::make_shared<Listener>();
    database->setDelegate(listener);
    const auto a = install("a");
    const auto b = install("b");
    database->findPlugIn(*a->uuid);
    fake.registry.uninstall(*a->uuid);
    listener->then = [&] { EXPECT_FALSE(database->findPlugIn(*a->uuid)) << "the delegate may use the database"; };
    fake.registry.fireWillUninstall({a, b});
    EXPECT_EQ(listener->removed, (std::vector<std::size_t>{2}));
    for (const auto& proxy : {a, b}) {
        EXPECT_TRUE(processLog.contains(LogLevel::standard, "ops",
                                        "plug-in UNINSTALLED:" + *proxy->bundleIdentifier + " " +
                                            *proxy->plugInIdentifier + "(1) " + proxy->uuid->text() + " " +
                                            proxy->bundleURL->path()));
    }
}

TEST_F(Database, UnplacedAndPlaceholderPlugInsAreSkipped) {
    install("good");
    auto unplaced = support::proxyFor(dataPlugIn("unplaced"));
    unplaced.bundleURL.reset();
    fake.registry.install(unplaced);
    auto placeholder = dataPlugIn("placeholder");
    placeholder.containingBundle = std::make_shared<platform::ApplicationRecord>(
        platform::ApplicationRecord{URL::file("/Applications/P.app"), {}, {}, true, true});
    fake.registry.install(placeholder);
    auto strange = dataPlugIn("strange");
    strange.containingBundle = std::make_shared<platform::ApplicationRecord>(
        platform::ApplicationRecord{URL::file("/Applications/S.app"), {}, {}, false, false});
    fake.registry.install(strange);

    EXPECT_EQ(found(std::nullopt), (std::set<std::string>{"com.example.good"}));
    const auto messages = processLog.messages("ops");
    const auto logged = [&](std::string_view start, std::string_view end) {
        return std::any_of(messages.begin(), messages.end(),
                           [&](const std::string& m) { return m.starts_with(start) && m.ends_with(end); });
    };
    EXPECT_TRUE(logged("skipping cx proxy ", " with nil bundleURL"));
    EXPECT_TRUE(logged("skipping cx proxy ", " because its app is a placeholder"));
    EXPECT_TRUE(logged("CX reported containingBundle is not an application", ""));
    EXPECT_TRUE(logged("CX reported 1 plug-ins (cache 0/1)", ""));
}

TEST_F(Database, SilentRegistryGivesNoneAndAnEmptyOneTheEmptySet) {
    EXPECT_TRUE(database->findPlugIns(std::nullopt)->empty());
    EXPECT_TRUE(database->findPlugIns(Dictionary{{"a", "b"}})->empty());
    fake.registry.answerNothing();
    EXPECT_FALSE(database->findPlugIns(std::nullopt));
    EXPECT_FALSE(database->findPlugIns(Dictionary{{"a", "b"}}));
}

TEST_F(Database, ElectionPrefilterKeepsWhatTheRuleAsksFor) {
    install("none");
    install("automatic", Dictionary{{"com.nordane.developer.auto-elect-plugin", true}});
    install("falsely", Dictionary{{"com.nordane.developer.auto-elect-plugin", "yes"}});
    install("elected");
    install("wide"); // stored election 257
    install("replacing", Dictionary{{"com.nordane.developer.replace-plugin", "com.example.elected"}});
    const auto annotate = [&](const std::string& name, const Value& election) {
        const auto installed = *fake.registry.installedPlugIns();
        for (const auto& proxy : installed) {
            if (proxy->plugInIdentifier != "com.example." + name) continue;
            database->setAnnotation(Dictionary{{"election", election}},
                                    *zbd::ZBDPlugIn::initWithCXData(fake.platform, proxy));
        }
    };
    annotate("elected", 1);
    annotate("wide", 257);

    const std::set<std::string> ones{"com.example.automatic", "com.example.elected", "com.example.wide",
                                     "com.example.replacing"};
    const std::set<std::string> zeros{"com.example.none", "com.example.falsely"};
    std::set<std::string> all = ones;
    all.insert(zeros.begin(), zeros.end());
    struct Case {
        Value pattern;
        std::set<std::string> expected;
    };
    for (const Case& c : {Case{"1", ones}, Case{"=1", ones}, Case{Array{"1", "=2"}, ones}, Case{"0", zeros},
                          Case{Array{"0", "1"}, all}, Case{"7", {}}, Case{Array(), {}}, Case{"=", {}},
                          // These build no prefilter, so the registry's whole answer stays.
                          Case{"<>1", all}, Case{"", all}, Case{Array{"1", "!1"}, all}, Case{Array{"1", 2}, all},
                          Case{1, all}, Case{true, all}}) {
        EXPECT_EQ(found(Dictionary{{"VKUserElection", c.pattern}}), c.expected) << c.pattern.description();
    }
    EXPECT_EQ(found(Dictionary{{"other", "1"}}), all);
}

TEST_F(Database, PrefilterLogsTheIdentifierUsed) {
    install("replacing", Dictionary{{"com.nordane.developer.replace-plugin", "com.example.elected"}});
    found(Dictionary{{"VKUserElection", "0"}});
    EXPECT_TRUE(processLog.contains(LogLevel::debug, "ops", "cx filter com.example.elected -> 1"));
    processLog.clear();
    found(Dictionary{{"VKUserElection", "<>0"}});
    for (const auto& message : processLog.messages("ops")) EXPECT_FALSE(message.starts_with("cx filter"));
}

TEST_F(Database, AutoElectionHappensWhenTheRecordIsBuilt) {
    const Dictionary entitled{{"com.nordane.developer.auto-elect-plugin", true}};
    const auto fresh = install("fresh", entitled);
    const auto decided = install("decided", entitled);
    const auto reset = install("reset", entitled);
    const auto unentitled = install("unentitled");
    const auto record = [&](const PlugInProxyRef& proxy) {
        return zbd::ZBDPlugIn::initWithCXData(fake.platform, proxy);
    };
    database->setAnnotation(Dictionary{{"election", 2}}, *record(decided));
    database->setAnnotation(Dictionary{{"election", 0}, {"extension", Dictionary{{"k", 1}}}}, *record(reset));

    const auto election = [&](const PlugInProxyRef& proxy) {
        return database->annotationForPlugIn(*database->findPlugIn(*proxy->uuid));
    };
    EXPECT_EQ(election(fresh), (Dictionary{{"election", 1}}));
    EXPECT_EQ(election(decided), (Dictionary{{"election", 2}}));
    EXPECT_EQ(election(reset), (Dictionary{{"election", 1}, {"extension", Dictionary{{"k", 1}}}}));
    EXPECT_FALSE(election(unentitled));
    EXPECT_TRUE(fake.notifications.posts().empty());
}

TEST_F(Database, ApplicationsPlugIns) {
    const auto application =
        fake.registry.installApplication({URL::file("/Applications/A.app"), "com.example.app", "A"});
    EXPECT_FALSE(database->plugInsWithinApplication(application->bundleURL));
    EXPECT_FALSE(database->plugInsWithinApplication(URL::file("/Applications/Unknown.app")));
    auto good = dataPlugIn("good");
    good.path = "/Applications/A.app/PlugIns/good.plugin";
    good.containingBundle = application;
    fake.registry.install(good);
    auto bad = good;
    bad.path = "/Applications/A.app/PlugIns/bad.plugin";
    bad.uuid = UUID::random();
    bad.info = support::manifestOf("com.example.bad", {});
    fake.registry.install(bad);
    const auto plugIns = database->plugInsWithinApplication(application->bundleURL);
    ASSERT_TRUE(plugIns);
    ASSERT_EQ(plugIns->size(), 1U);
    EXPECT_EQ(plugIns->front()->identifier(), Value("com.example.good"));
}

TEST_F(Database, RegistrationReportsTheRegistrysRefusal) {
    const URL url = URL::file("/a");
    EXPECT_EQ(database->addPlugIn(url), (platform::Error{"Zembra", 2, "Catalix failed to register the plug-in"}));
    EXPECT_EQ(database->removePlugIn(url), (platform::Error{"Zembra", 2, "Catalix failed to deregister the plug-in"}));
    fake.registry.allowRegistration();
    EXPECT_FALSE(database->addPlugIn(url));
    EXPECT_FALSE(database->removePlugIn(url));
}

TEST_F(Database, BuildingOffTheQueueStopsTheProcess) {
    const auto proxy = install("a");
    EXPECT_DEATH(database->createPlugInForProxy(proxy), "ZBDatabase");
    EXPECT_DEATH(database->purgeCachesToLimit(0), "ZBDatabase");
}

} // namespace
