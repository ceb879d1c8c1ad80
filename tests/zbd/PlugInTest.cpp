#include "Zembra/ZBUtilities.h"
#include "tests/support/Requests.h"

namespace {

using namespace platform;
using support::processLog;
using zbd::ZBDPlugIn;
using zembra::dictionaryChanging;

struct PlugIn : support::Requests {
    std::shared_ptr<ZBDPlugIn> make(PlugInProxy proxy) {
        return ZBDPlugIn::initWithCXData(fake.platform, fake.registry.install(std::move(proxy)));
    }
    PlugInProxy code(const Dictionary& extension = {}) { return support::proxyFor(described(1, extension)); }
    PlugInProxy data() { return code({{"VKExtensionProtocol", "#Data"}}); }
    MutableDictionary augmented(const PlugInProxy& proxy) {
        MutableDictionary form;
        make(proxy)->augmentForm(form);
        return form;
    }
};

TEST_F(PlugIn, TakesItsFactsFromTheProxy) {
    const auto action = [](const char* name) { return Dictionary{{"VKExtensionFilevaneActionName", name}}; };
    fake.registry.setStringTable(pathOf(1), "Localizable", {{"turn", "Drehen"}});
    auto proxy = code({{"VKExtensionFilevaneActions", Array{action("turn"), action("flip"), Value(3)}}});
    proxy.localizedShortName = "Short";
    proxy.registrationDate = Date{-1.9};
    proxy.entitlements = Dictionary{{"text", "NO"}, {"zero", 0}};
    const auto plugIn = make(proxy);
    EXPECT_EQ((Array{plugIn->localizedShortName(), plugIn->localizedContainingName()}), (Array{"Short", "A"}));
    EXPECT_EQ(plugIn->localizedFilevaneActionNames(), (Dictionary{{"turn", "Drehen"}, {"flip", "flip"}}));
    EXPECT_EQ(plugIn->lastModified(), -1) << "truncated toward zero";
    EXPECT_TRUE(plugIn->hasEntitlement("text"));
    EXPECT_FALSE(plugIn->hasEntitlement("zero"));
    // The protocol's version is stated, or follows from the style.
    EXPECT_EQ(plugIn->hubProtocolVersion(), 2U);
    proxy.infoDictionary = dictionaryChanging(proxy.infoDictionary, "Zembra", Dictionary());
    EXPECT_EQ(make(proxy)->hubProtocolVersion(), 1U);
    proxy.plugInDictionary = dictionaryChanging(proxy.plugInDictionary, "HubProtocolVersion", 5);
    EXPECT_EQ(make(proxy)->hubProtocolVersion(), 5U);
}

TEST_F(PlugIn, MisconfiguredOnesAreRefusedWithTheirReason) {
    auto uncontained = code();
    uncontained.dataContainerURL.reset();
    auto outside = support::proxyFor(support::dataPlugIn("data"));
    outside.bundleURL = URL::file("/SystemX/Library/data.plugin");
    for (const auto& [proxy, reason] : {std::pair(uncontained, "this plug-in has no sandbox data container"),
                                        {outside, "plug-ins outside containing apps must be in /System"}}) {
        EXPECT_FALSE(make(proxy));
        expectLogged(info, "ignoring mis-configured plug-in at " + proxy.bundleURL->path() + ": " + reason);
    }
}

TEST_F(PlugIn, ManifestFollowsTheRegistry) {
    auto proxy = data();
    const auto plugIn = make(proxy);
    const auto expectVersions = [&](const Value& expected, int lookUps) {
        fake.registry.resetCalls();
        for (int i = 0; i < 2; ++i) EXPECT_EQ(plugIn->infoKey("VBBundleVersion"), expected);
        EXPECT_EQ(fake.registry.calls("plugInForUUID"), lookUps) << expected.description();
    };
    expectVersions("1", 0);
    proxy.infoDictionary = dictionaryChanging(proxy.infoDictionary, "VBBundleVersion", "2");
    fake.registry.install(proxy);
    expectVersions("2", 1);
    fake.registry.uninstall(uuid(1));
    expectVersions(Value(), 1);
    EXPECT_EQ(plugIn->identifier(), Value("com.example.1")) << "facts stay";
    expectLogged(error, "could not obtain fresh proxy for " + idOf(1));
    const std::string fallback = " fallback to path " + proxy.bundleURL->absoluteString();
    expectLogged(standard, "Failed to find Plugin by " + idOf(1) + fallback, "cx");
    proxy.uuid.reset();
    fake.registry.install(proxy); // found by its location
    fake.registry.setKnowledgeUUID(std::nullopt);
    expectVersions("2", 2);
    EXPECT_NE(make(proxy)->uuid(), make(proxy)->uuid()) << "each record has its own";
}

TEST_F(PlugIn, KeptFormFollowsTheRegistryAndTokensAreIssuedEachTime) {
    processLog.setLevel("cx", info);
    auto proxy = code({{"Shared", Array{"."}}});
    fake.sandbox.allowFile(pathOf(1));
    fake.sandbox.services.insert("com.example.1");
    const auto plugIn = make(proxy);
    const auto form = [&](bool isKept = true) {
        auto made = isKept ? plugIn->currentForm(nullptr) : plugIn->exportForm(nullptr);
        plugIn->augmentForm(made);
        return made;
    };
    form();
    form().set("identifier", "changed");
    EXPECT_EQ(form(), form(false)) << "each caller has its own";
    fake.sandbox.issueError = 13;
    EXPECT_EQ(form().dictionary("extensions"), Dictionary());
    EXPECT_FALSE(form().contains("service-extension"));
    fake.sandbox.issueError = 0;
    proxy.infoDictionary = dictionaryChanging(proxy.infoDictionary, "VBBundleVersion", "2");
    fake.registry.install(proxy);
    for (int time = 0; time < 3; ++time) {
        EXPECT_EQ(form().dictionary("bundleInfo")->string("VBBundleVersion"), "2");
        EXPECT_EQ(form(), form(false));
    }
    plugIn->setLocalizedName("Neu");
    EXPECT_EQ(form()["localizedDisplayName"], Value("Neu"));
    processLog.setLevel("cx", debug);
}

TEST_F(PlugIn, PrunedDictionaryLosesBuildToolEntries) {
    EXPECT_EQ(ZBDPlugIn::prunedInfoDictionaryFor(Dictionary{{"DTBuild", 1}, {"DT", 2}, {"aDT", 3}, {"D", 4}}),
              (Dictionary{{"aDT", 3}, {"D", 4}}));
}

TEST_F(PlugIn, FormCarriesTheTokensThatTheSandboxGrants) {
    using Names = std::vector<std::string>;
    const std::string whole = application + std::string("/PlugIns/1.appex");
    for (const auto& file : {pathOf(1), pathOf(1) + "/Fonts", whole, whole + "/Fonts"}) fake.sandbox.allowFile(file);
    const auto shared = [&](const Value& resources, const std::string& path = pathOf(1)) {
        auto proxy = code({{"Shared", resources}});
        proxy.bundleURL = URL::file(path);
        const auto form = augmented(proxy);
        Names names;
        const Dictionary tokens = form.dictionary("extensions").value();
        for (const auto& entry : tokens) names.emplace_back(entry.name());
        return names;
    };
    EXPECT_EQ(shared(Array{"Fonts", 7, "Sounds", "."}), (Names{"Fonts", "."}));
    EXPECT_EQ(shared("Fonts"), Names{"Fonts"});
    EXPECT_EQ(shared(Array{"Fonts"}, whole), Names{"."});
    EXPECT_TRUE(augmented(code()).empty()) << "nothing is shared, and no service known";
    const std::string end = " in plug-in at " + pathOf(1) + ": Operation not permitted";
    expectLogged(info, "failed to make extension for " + pathOf(1) + "/Sounds" + end);
    expectLogged(info, "failed to make mach extension for com.example.1" + end);
    fake.sandbox.services.insert("com.example.1");
    EXPECT_TRUE(augmented(code()).contains("service-extension"));
    EXPECT_TRUE(augmented(data()).empty()) << "without code there is no service";
}

} // namespace
