#include "tests/support/Requests.h"

namespace {

using namespace platform;
using support::dataPlugIn;
using support::processLog;
using Names = std::set<std::string>;

struct Database : support::Requests {
    zbd::ZBDatabase& database = *daemon.server;

    /// A data plug-in, installed, with that entitlement.
    PlugInProxyRef entitled(const std::string& name, const char* entitlement, const Value& value) {
        return fake.install(name, Dictionary{{std::string("com.nordane.developer.") + entitlement, value}});
    }
    PlugInProxyRef annotated(const PlugInProxyRef& proxy, const Dictionary& annotation) {
        database.setAnnotation(annotation, *zbd::ZBDPlugIn::initWithCXData(fake.platform, proxy));
        return proxy;
    }
    /// How many records were built.
    static long builds() { return std::ranges::count(processLog.messages("ops"), "createPlugInForProxy"); }
    Names found(const std::optional<Dictionary>& query) {
        Names names;
        const auto plugIns = database.findPlugIns(query);
        for (const auto& plugIn : plugIns ? *plugIns : std::vector<zbd::ZBDPlugInRef>())
            names.emplace(plugIn->identifier().string()->substr(12)); // "com.example."
        return names;
    }
};

TEST_F(Database, RecordIsBuiltOnceAndFoundByEveryWay) {
    const auto proxy = fake.install("a");
    const auto plugIn = database.findPlugIn(*proxy->uuid);
    fake.registry.fireDidInstall({proxy}); // leaves the cache alone
    EXPECT_EQ(database.findPlugInAtPath(*proxy->bundleURL), plugIn);
    EXPECT_EQ(database.plugInForProxy(proxy), plugIn);
    EXPECT_EQ(*database.findPlugIns(std::nullopt), std::vector{plugIn});
    EXPECT_EQ(builds(), 1);
    fake.locale.setLanguages({"de", "en"});
    EXPECT_NE(database.findPlugIn(*proxy->uuid), plugIn) << "its names may be others now";
    database.setCacheLimit(0);
    database.findPlugIn(*fake.install("b")->uuid);
    expectLogged(info, "purging cache for 1 > 0");
    expectLogged(standard, "plug-in INSTALLED:com.example.a com.example.a(1) " + proxy->uuid->text() + " " +
                               proxy->bundleURL->path());
}

TEST_F(Database, RecordsAreListedAnewWhenOneIsGone) {
    const auto list = [this] { return database.findPlugIns(std::nullopt); };
    std::vector<PlugInProxyRef> proxies{fake.install("a"), fake.install("b")};
    const auto first = list();
    EXPECT_EQ(list(), first);
    database.pluginsWillUninstall({proxies[0]}); // and comes again
    EXPECT_EQ(builds(), 2);
    EXPECT_NE(list(), first);
    EXPECT_EQ(builds(), 3);
    fake.locale.setLanguages({"de", "en"});
    list();
    EXPECT_EQ(builds(), 5);
    // What is left out is tried, and told of, each time.
    auto bad = dataPlugIn("bad");
    bad.info = support::manifestOf("com.example.bad", {});
    fake.registry.install(bad);
    for (const int expected : {6, 7}) {
        EXPECT_EQ(found(std::nullopt), (Names{"a", "b"}));
        EXPECT_EQ(builds(), expected);
    }
}

TEST_F(Database, UninstalledPlugInsHaveTheirInstancesEnded) {
    fake.serviceManager.allow();
    fake.serviceManager.holdAnswers();
    fake.serviceManager.addInstance("com.example.1", "1");
    fake.serviceManager.fail("com.example.3", "1", 5);
    std::vector<PlugInProxyRef> proxies;
    for (const int number : {1, 2, 3}) {
        auto proxy = support::proxyFor(described(number));
        if (number == 2) proxy.infoDictionary.reset(); // and with it the version
        proxies.push_back(fake.registry.install(proxy));
    }
    database.findPlugIn(uuid(1));
    fake.registry.uninstall(uuid(1));
    fake.registry.fireWillUninstall(proxies);
    EXPECT_FALSE(database.findPlugIn(uuid(1)));
    EXPECT_FALSE(database.plugInForProxy(proxies[0])) << "a discovery may have taken it before";
    const std::pair<LogLevel, const char*> results[] = {
        {info, "one or more plug-ins have been terminated for uuid="},
        {debug, "ignitd reported no plug-ins on record for uuid="},
        {error, "ignitd error attempting to terminate plug-ins: error=5 for uuid="}};
    for (int i = 0; i < 3; ++i) {
        const auto& [level, line] = results[i];
        const std::string name = "com.example." + std::to_string(i + 1);
        expectLogged(standard, "plug-in UNINSTALLED:" + name + " " + name + "(1) " + idOf(i + 1) + " " + pathOf(i + 1));
        EXPECT_EQ(fake.serviceManager.removals().at(i), std::pair(name, std::string("1")));
        EXPECT_TRUE(fake.serviceManager.answer());
        expectLogged(level, line + idOf(i + 1));
    }
    EXPECT_TRUE(processLog.messages("ops").back().starts_with("removal complete for "));
}

TEST_F(Database, UnusablePlugInsAreSkipped) {
    const URL url = URL::file(application);
    for (const auto& [name, record] : {std::pair("good", ApplicationRecord{url, {}, {}}),
                                       {"misconfigured", {url, {}, {}}},
                                       {"placeholder", {URL::file("/P.app"), {}, {}, true, true}},
                                       {"strange", {URL::file("/S"), {}, {}, false, false}}}) {
        auto plugIn = dataPlugIn(name);
        plugIn.containingBundle = std::make_shared<ApplicationRecord>(record);
        if (name == std::string("misconfigured")) plugIn.info = support::manifestOf("com.example.bad", {});
        fake.registry.install(plugIn);
    }
    auto unplaced = *fake.install("unplaced");
    unplaced.bundleURL.reset();
    fake.registry.install(unplaced);
    EXPECT_EQ(found(std::nullopt), Names{"good"});
    EXPECT_EQ(database.plugInsWithinApplication(url)->size(), 1U);
}

TEST_F(Database, ElectionPrefilterKeepsWhatTheRuleAsksFor) {
    fake.install("none");
    entitled("automatic", "auto-elect-plugin", true);
    entitled("falsely", "auto-elect-plugin", "yes");
    annotated(fake.install("elected"), {{"election", 1}});
    annotated(fake.install("wide"), {{"election", 257}});
    entitled("replacing", "replace-plugin", "com.example.elected");
    const Names all{"automatic", "elected", "wide", "replacing", "none", "falsely"};
    const std::pair<std::vector<Value>, Names> cases[] = {
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
}

TEST_F(Database, AutoElectionHappensWhenTheRecordIsBuilt) {
    for (const auto& [before, after] : {std::pair(0, 1), {2, 2}}) {
        const auto proxy = annotated(entitled(std::to_string(before), "auto-elect-plugin", true),
                                     {{"election", before}, {"extension", Dictionary()}});
        EXPECT_EQ(database.annotationForPlugIn(*database.findPlugIn(*proxy->uuid)),
                  (Dictionary{{"election", after}, {"extension", Dictionary()}}));
    }
    EXPECT_EQ(posts(), 0U);
}

} // namespace
