#include "Zembra/ZBUtilities.h"
#include "tests/support/FakePlatform.h"
#include "zbd/ZBDPlugIn.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::logged;
using support::processLog;
using zbd::ZBDPlugIn;
using zembra::dictionaryChanging;

struct PlugIn : testing::Test {
    support::FakePlatform fake;

    std::shared_ptr<ZBDPlugIn> make(PlugInProxy proxy) {
        return ZBDPlugIn::initWithCXData(fake.platform, fake.registry.install(std::move(proxy)));
    }
    MutableDictionary augmented(const PlugInProxy& proxy) {
        MutableDictionary form;
        make(proxy)->augmentForm(form);
        return form;
    }
    static PlugInProxy data() { return support::proxyFor(support::dataPlugIn("data")); }
    /// A plug-in with code, in an application. `extension` completes its dictionary.
    static PlugInProxy code(const std::string& suffix = ".plugin", const Dictionary& extension = {}) {
        auto described = support::dataPlugIn("code");
        described.path = "/Applications/A.app/PlugIns/code" + suffix;
        MutableDictionary declared{{"VKExtensionProtocol", "Proto"}, {"VKExtensionAttributes", Dictionary()}};
        declared.merge(extension);
        described.info = support::manifestOf("com.example.code", declared);
        described.onSystemPartition = false;
        described.containingBundle = std::make_shared<ApplicationRecord>(
            ApplicationRecord{URL::file("/Applications/A.app"), "com.example.a", "A"});
        return support::proxyFor(described);
    }
};

TEST_F(PlugIn, TakesItsFactsFromTheProxy) {
    auto proxy = code();
    proxy.localizedName = "Name";
    proxy.localizedShortName = "Short";
    proxy.originalIdentifier = "com.example.original";
    proxy.registrationDate = Date{-1.9};
    proxy.entitlements = Dictionary{{"true", true}, {"false", false}, {"zero", 0}, {"text", "NO"}, {"array", Array()}};
    const auto plugIn = make(proxy);
    EXPECT_EQ(plugIn->localizedName(), Value("Name"));
    EXPECT_EQ(plugIn->localizedShortName(), Value("Short"));
    EXPECT_EQ(plugIn->localizedContainingName(), Value("A"));
    EXPECT_EQ(plugIn->originalIdentifier(), Value("com.example.original"));
    EXPECT_EQ(plugIn->lastModified(), -1) << "truncated toward zero";
    // Entitlements count unless they are false.
    for (const char* held : {"true", "text", "array"}) EXPECT_TRUE(plugIn->hasEntitlement(held)) << held;
    for (const char* lacking : {"false", "zero", "absent"}) EXPECT_FALSE(plugIn->hasEntitlement(lacking)) << lacking;
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
    auto outside = data();
    outside.bundleURL = URL::file("/SystemX/Library/data.plugin");
    for (const auto& [proxy, reason] : {std::pair(uncontained, "this plug-in has no sandbox data container"),
                                        {outside, "plug-ins outside containing apps must be in /System"}}) {
        EXPECT_FALSE(make(proxy));
        const std::string start = "ignoring mis-configured plug-in at " + proxy.bundleURL->path();
        EXPECT_TRUE(logged(LogLevel::info, start + ": " + reason));
    }
    auto proxy = data();
    proxy.dataContainerURL.reset(); // which plug-ins without code need not have
    EXPECT_TRUE(make(proxy));
    proxy.plugInIdentifier.reset();
    EXPECT_FALSE(make(proxy));
    proxy.bundleURL.reset();
    EXPECT_FALSE(make(proxy));
}

TEST_F(PlugIn, ManifestFollowsTheRegistry) {
    auto proxy = data();
    const auto plugIn = make(proxy);
    const auto version = [&] { return plugIn->infoKey("VBBundleVersion"); };
    const auto lookUps = [&] { return fake.registry.calls("plugInForUUID"); };
    const int before = lookUps();
    EXPECT_EQ(version(), Value("1"));
    EXPECT_EQ(lookUps(), before) << "nothing changed since it was made";
    proxy.infoDictionary = dictionaryChanging(proxy.infoDictionary, "VBBundleVersion", "2");
    fake.registry.install(proxy);
    for (int i = 0; i < 2; ++i) EXPECT_EQ(version(), Value("2"));
    EXPECT_EQ(lookUps(), before + 1);

    fake.registry.uninstall(*proxy.uuid);
    EXPECT_FALSE(version());
    EXPECT_EQ(plugIn->identifier(), Value("com.example.data")) << "facts stay";
    const std::string uuid = proxy.uuid->text();
    const std::string fallback = " fallback to path " + proxy.bundleURL->absoluteString();
    EXPECT_TRUE(logged(LogLevel::error, "could not obtain fresh proxy for " + uuid));
    EXPECT_TRUE(logged(LogLevel::standard, "Failed to find Plugin by " + uuid + fallback, "cx"));
    proxy.uuid.reset();
    fake.registry.install(proxy);
    EXPECT_EQ(version(), Value("2")) << "found by its location";
    EXPECT_NE(make(proxy)->uuid(), make(proxy)->uuid()) << "each record has its own";

    fake.registry.setKnowledgeUUID(std::nullopt); // then the registry is asked each time
    const int asked = lookUps();
    for (int i = 0; i < 2; ++i) version();
    EXPECT_EQ(lookUps(), asked + 2);
}

TEST_F(PlugIn, KeptFormFollowsTheRegistryAndTokensAreIssuedEachTime) {
    processLog.setLevel("cx", LogLevel::info);
    auto proxy = code(".appex");
    fake.sandbox.allowFile(proxy.bundleURL->path());
    fake.sandbox.services.insert("com.example.code");
    const auto plugIn = make(proxy);
    const auto form = [&](bool isKept = true) {
        auto made = isKept ? plugIn->currentForm(nullptr) : plugIn->exportForm(nullptr);
        plugIn->augmentForm(made);
        return made;
    };
    const auto first = form();
    EXPECT_EQ(first, form(false));
    form().set("identifier", "changed");
    EXPECT_EQ(form(), first) << "each caller has its own";

    fake.sandbox.issueError = 13;
    EXPECT_EQ(form().dictionary("extensions"), Dictionary());
    EXPECT_FALSE(form().contains("service-extension"));
    fake.sandbox.issueError = 0;
    EXPECT_EQ(form(), first);
    proxy.infoDictionary = dictionaryChanging(proxy.infoDictionary, "VBBundleVersion", "2");
    fake.registry.install(proxy);
    for (int time = 0; time < 3; ++time) {
        EXPECT_EQ(form().dictionary("bundleInfo")->string("VBBundleVersion"), "2");
        EXPECT_EQ(form(), form(false));
    }
    plugIn->setLocalizedName("Neu");
    EXPECT_EQ(form()["localizedDisplayName"], Value("Neu"));
    processLog.setLevel("cx", LogLevel::debug);
}

TEST_F(PlugIn, PrunedDictionaryLosesBuildToolEntries) {
    EXPECT_EQ(ZBDPlugIn::prunedInfoDictionaryFor(Dictionary{{"DTBuild", 1}, {"DT", 2}, {"aDT", 3}, {"D", 4}}),
              (Dictionary{{"aDT", 3}, {"D", 4}}));
}

TEST_F(PlugIn, ActionNamesAreLocalizedOrThemselves) {
    const auto action = [](const char* name) { return Dictionary{{"VKExtensionFilevaneActionName", name}}; };
    const Array actions{action("turn"), action("turn"), action("flip"), Dictionary(), Value(3)};
    const auto proxy = code(".plugin", {{"VKExtensionFilevaneActions", actions}});
    fake.registry.setStringTable(proxy.bundleURL->path(), "Localizable", {{"turn", "Drehen"}});
    EXPECT_EQ(make(proxy)->localizedFilevaneActionNames(), (Dictionary{{"turn", "Drehen"}, {"flip", "flip"}}));
    EXPECT_TRUE(logged(LogLevel::error, "missing VKExtensionFilevaneActionName for plugin ", "cx"));
}

TEST_F(PlugIn, FormCarriesTheTokensThatTheSandboxGrants) {
    for (const char* file : {".plugin", ".plugin/Fonts", ".appex", ".appex/Fonts"})
        fake.sandbox.allowFile("/Applications/A.app/PlugIns/code" + std::string(file));
    const auto shared = [&](const Value& resources, const std::string& suffix = ".plugin") {
        const auto form = augmented(code(suffix, {{"Shared", resources}}));
        std::vector<std::string> names;
        for (const auto& entry : form.dictionary("extensions").value()) names.emplace_back(entry.name());
        return names;
    };
    using Names = std::vector<std::string>;
    EXPECT_EQ(shared(Array{"Fonts", 7, "Sounds", "."}), (Names{"Fonts", "."}));
    EXPECT_EQ(shared("Fonts"), Names{"Fonts"});
    EXPECT_EQ(shared(Array()), Names());
    EXPECT_EQ(shared(Array{"Fonts"}, ".appex"), Names{"."}) << "the whole bundle";
    EXPECT_TRUE(augmented(code()).empty()) << "nothing is shared, and no service known";
    const std::string end = " in plug-in at /Applications/A.app/PlugIns/code.plugin: Operation not permitted";
    EXPECT_TRUE(
        logged(LogLevel::info, "failed to make extension for /Applications/A.app/PlugIns/code.plugin/Sounds" + end));
    EXPECT_TRUE(logged(LogLevel::info, "failed to make mach extension for com.example.code" + end));
    for (const char* identifier : {"com.example.code", "com.example.data"}) fake.sandbox.services.insert(identifier);
    EXPECT_TRUE(augmented(code()).contains("service-extension"));
    EXPECT_TRUE(augmented(data()).empty()) << "without code there is no service";
}

TEST(RecentForms, KeepsWhatComesBackBeforeManyOthers) {
    constexpr std::size_t capacity = zbd::RecentForms::capacity;
    zbd::RecentForms forms;
    const auto [number, isAgain] = forms.countMade(0);
    EXPECT_FALSE(isAgain) << "the first time";
    for (std::size_t others = 1; others < capacity; ++others) forms.countMade(0);
    EXPECT_TRUE(forms.countMade(number).second);
    EXPECT_FALSE(forms.countMade(number).second) << "too many others";
    std::vector<std::weak_ptr<int>> kept;
    for (std::size_t i = 0; i < capacity + 2; ++i) {
        const auto form = std::make_shared<int>();
        kept.emplace_back(form);
        forms.keep(form);
        EXPECT_EQ(kept[0].expired(), i >= capacity) << "what was kept first goes first";
    }
    EXPECT_TRUE(kept[1].expired());
    EXPECT_FALSE(kept[2].expired());
}

} // namespace
