#include "tests/support/FakePlatform.h"
#include "zbd/ZBDatabase.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::dataPlugIn;
using support::logged;
using support::processLog;

class TestDatabase : public zbd::ZBDatabase {
public:
    explicit TestDatabase(Platform& platform) : ZBDatabase(platform) {}
};

struct Delegate : zbd::ZBDatabaseDelegate {
    std::function<void(std::size_t)> then;
    void removedPlugIns(const std::vector<PlugInProxyRef>& proxies) override { then(proxies.size()); }
};

struct Database : testing::Test {
    support::FakePlatform fake;
    std::shared_ptr<TestDatabase> database = std::make_shared<TestDatabase>(fake.platform);
    const Dictionary autoElect{{"com.nordane.developer.auto-elect-plugin", true}};

    void SetUp() override {
        ASSERT_TRUE(database->initWithDatabase(std::nullopt));
        processLog.clear();
    }
    PlugInProxyRef install(const std::string& name, std::optional<Dictionary> entitlements = {}) {
        auto described = dataPlugIn(name);
        described.entitlements = std::move(entitlements);
        return fake.registry.install(described);
    }
    void annotate(const PlugInProxyRef& proxy, const Dictionary& annotation) {
        database->setAnnotation(annotation, *zbd::ZBDPlugIn::initWithCXData(fake.platform, proxy));
    }
    /// How many records were built since the log was cleared.
    static long builds() {
        const auto messages = processLog.messages("ops");
        return std::count(messages.begin(), messages.end(), "createPlugInForProxy");
    }
    std::set<std::string> found(const std::optional<Dictionary>& query) {
        std::set<std::string> names;
        const auto plugIns = database->findPlugIns(query);
        EXPECT_TRUE(plugIns);
        for (const auto& plugIn : *plugIns) names.emplace(plugIn->identifier().string()->substr(12)); // "com.example."
        return names;
    }
};

TEST_F(Database, RecordIsBuiltOnceAndFoundByEveryWay) {
    const auto proxy = install("a");
    const auto plugIn = database->findPlugIn(*proxy->uuid);
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(database->findPlugInAtPath(*proxy->bundleURL), plugIn);
    EXPECT_EQ(database->plugInForProxy(proxy), plugIn);
    EXPECT_EQ(database->findPlugIns(std::nullopt), std::vector{plugIn});
    EXPECT_EQ(builds(), 1);

    fake.registry.fireDidInstall({proxy}); // leaves the cache alone
    EXPECT_EQ(database->findPlugIn(*proxy->uuid), plugIn);
    EXPECT_TRUE(logged(LogLevel::standard, "plug-in INSTALLED:com.example.a com.example.a(1) " + proxy->uuid->text() +
                                               " " + proxy->bundleURL->path()));
}

TEST_F(Database, UnknownPlugInsAreLogged) {
    const auto unknown = UUID::random();
    EXPECT_FALSE(database->findPlugIn(unknown));
    EXPECT_TRUE(logged(LogLevel::info, "Catalix cannot find plug-in with UUID:" + unknown.text()));
    EXPECT_FALSE(database->findPlugInAtPath(URL::file("/nowhere")));
    EXPECT_TRUE(logged(LogLevel::info, "Catalix cannot find plug-in at path:/nowhere"));
}

TEST_F(Database, UnusableProxyIsTriedAgainEachTime) {
    auto described = dataPlugIn("bad");
    described.path = "/elsewhere/bad.plugin";
    const auto proxy = fake.registry.install(described);
    for (int i = 0; i < 2; ++i) EXPECT_FALSE(database->findPlugIn(*proxy->uuid));
    EXPECT_EQ(builds(), 2);
    EXPECT_TRUE(found(std::nullopt).empty());
}

TEST_F(Database, CacheIsPurgedWholeWhenItOutgrowsItsLimit) {
    database->setCacheLimit(2);
    for (const char* name : {"a", "b", "c", "d"}) install(name);
    const auto proxies = *fake.registry.installedPlugIns();
    // Three records fit, for the test before the third sees two; the fourth finds three.
    for (const auto& [index, built] : {std::pair(0U, 1), {1U, 2}, {2U, 3}, {0U, 3}, {3U, 4}, {3U, 4}, {0U, 5}}) {
        database->findPlugIn(*proxies[index]->uuid);
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
    const auto delegate = std::make_shared<Delegate>();
    database->setDelegate(delegate);
    const auto a = install("a");
    const auto b = install("b");
    database->findPlugIn(*a->uuid);
    fake.registry.uninstall(*a->uuid);
    std::vector<std::size_t> told;
    delegate->then = [&](std::size_t count) {
        told.push_back(count);
        EXPECT_FALSE(database->findPlugIn(*a->uuid)) << "the delegate may use the database";
    };
    fake.registry.fireWillUninstall({a, b});
    EXPECT_EQ(told, (std::vector<std::size_t>{2}));
    for (const auto& proxy : {a, b}) {
        const std::string identifier = *proxy->bundleIdentifier;
        EXPECT_TRUE(logged(LogLevel::standard, "plug-in UNINSTALLED:" + identifier + " " + identifier + "(1) " +
                                                   proxy->uuid->text() + " " + proxy->bundleURL->path()));
    }
    // A discovery may have taken b's proxy before b was replaced and its notice came.
    auto newer = *b;
    newer.localizedName = "newer";
    fake.registry.install(newer);
    database->plugInForProxy(b);
    EXPECT_EQ(database->findPlugIn(*b->uuid)->localizedName(), Value("newer"));
}

TEST_F(Database, UnplacedAndPlaceholderPlugInsAreSkipped) {
    install("good");
    auto unplaced = support::proxyFor(dataPlugIn("unplaced"));
    unplaced.bundleURL.reset();
    fake.registry.install(unplaced);
    for (const bool isApplication : {true, false}) {
        auto within = dataPlugIn(isApplication ? "placeholder" : "strange");
        within.containingBundle = std::make_shared<ApplicationRecord>(
            ApplicationRecord{URL::file("/Applications/P.app"), {}, {}, isApplication, isApplication});
        fake.registry.install(within);
    }
    EXPECT_EQ(found(std::nullopt), (std::set<std::string>{"good"}));
    const auto messages = processLog.messages("ops");
    for (const char* end : {" with nil bundleURL", " because its app is a placeholder"}) {
        EXPECT_TRUE(std::any_of(messages.begin(), messages.end(), [&](const std::string& message) {
            return message.starts_with("skipping cx proxy ") && message.ends_with(end);
        })) << end;
    }
    const std::string log = testing::PrintToString(messages);
    EXPECT_NE(log.find("CX reported containingBundle is not an application"), std::string::npos);
    EXPECT_NE(log.find("CX reported 1 plug-ins (cache 0/1)"), std::string::npos);
}

TEST_F(Database, SilentRegistryGivesNoneAndAnEmptyOneTheEmptySet) {
    for (const auto& query : {std::optional<Dictionary>(), std::optional(Dictionary{{"a", "b"}})}) {
        fake.registry.answerNothing(false);
        EXPECT_TRUE(database->findPlugIns(query)->empty());
        fake.registry.answerNothing();
        EXPECT_FALSE(database->findPlugIns(query));
    }
}

TEST_F(Database, ElectionPrefilterKeepsWhatTheRuleAsksFor) {
    install("none");
    install("automatic", autoElect);
    install("falsely", Dictionary{{"com.nordane.developer.auto-elect-plugin", "yes"}});
    annotate(install("elected"), {{"election", 1}});
    annotate(install("wide"), {{"election", 257}});
    install("replacing", Dictionary{{"com.nordane.developer.replace-plugin", "com.example.elected"}});

    const std::set<std::string> ones{"automatic", "elected", "wide", "replacing"};
    const std::set<std::string> zeros{"none", "falsely"};
    const std::set<std::string> all{"automatic", "elected", "wide", "replacing", "none", "falsely"};
    const std::pair<Value, std::set<std::string>> cases[] = {
        {"1", ones},
        {"=1", ones},
        {Array{"1", "=2"}, ones},
        {"0", zeros},
        {Array{"0", "1"}, all},
        {"7", {}},
        {Array(), {}},
        {"=", {}},
        // These build no prefilter, so the registry's whole answer stays.
        {"<>1", all},
        {"", all},
        {Array{"1", "!1"}, all},
        {Array{"1", 2}, all},
        {1, all},
        {true, all},
        {Value(), all},
    };
    for (const auto& [pattern, expected] : cases) {
        MutableDictionary query{{"other", "1"}};
        if (pattern) query.set("VKUserElection", pattern);
        EXPECT_EQ(found(query), expected) << pattern.description();
    }
}

TEST_F(Database, AutoElectionHappensWhenTheRecordIsBuilt) {
    const auto fresh = install("fresh", autoElect);
    const auto decided = install("decided", autoElect);
    const auto reset = install("reset", autoElect);
    const auto unentitled = install("unentitled");
    annotate(decided, {{"election", 2}});
    annotate(reset, {{"election", 0}, {"extension", Dictionary{{"k", 1}}}});
    const auto annotation = [&](const PlugInProxyRef& proxy) {
        return database->annotationForPlugIn(*database->findPlugIn(*proxy->uuid));
    };
    EXPECT_EQ(annotation(fresh), (Dictionary{{"election", 1}}));
    EXPECT_EQ(annotation(decided), (Dictionary{{"election", 2}}));
    EXPECT_EQ(annotation(reset), (Dictionary{{"election", 1}, {"extension", Dictionary{{"k", 1}}}}));
    EXPECT_FALSE(annotation(unentitled));
    EXPECT_TRUE(fake.notifications.posts().empty());
}

TEST_F(Database, ApplicationsPlugIns) {
    const auto application =
        fake.registry.installApplication({URL::file("/Applications/A.app"), "com.example.app", "A"});
    for (const char* path : {"/Applications/A.app", "/Applications/Unknown.app"}) {
        EXPECT_FALSE(database->plugInsWithinApplication(URL::file(path)));
    }
    for (const char* name : {"good", "bad"}) {
        auto within = dataPlugIn(name);
        within.path = "/Applications/A.app/PlugIns/" + std::string(name) + ".plugin";
        within.containingBundle = application;
        if (name == std::string("bad")) within.info = support::manifestOf("com.example.bad", {});
        fake.registry.install(within);
    }
    const auto plugIns = database->plugInsWithinApplication(application->bundleURL);
    ASSERT_TRUE(plugIns);
    ASSERT_EQ(plugIns->size(), 1U);
    EXPECT_EQ(plugIns->front()->identifier(), Value("com.example.good"));
}

TEST_F(Database, RegistrationReportsTheRegistrysRefusal) {
    const URL url = URL::file("/a");
    EXPECT_EQ(database->addPlugIn(url), (Error{"Zembra", 2, "Catalix failed to register the plug-in"}));
    EXPECT_EQ(database->removePlugIn(url), (Error{"Zembra", 2, "Catalix failed to deregister the plug-in"}));
    fake.registry.allowRegistration();
    EXPECT_FALSE(database->addPlugIn(url));
    EXPECT_FALSE(database->removePlugIn(url));
}

TEST_F(Database, BuildingOffTheQueueStopsTheProcess) {
    EXPECT_DEATH(database->createPlugInForProxy(install("a")), "ZBDatabase");
    EXPECT_DEATH(database->purgeCachesToLimit(0), "ZBDatabase");
}

} // namespace
