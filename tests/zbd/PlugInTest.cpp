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
    static PlugInProxy data(const std::string& name = "data") { return support::proxyFor(support::dataPlugIn(name)); }
    /// A plug-in with code, in an application.
    static PlugInProxy code(const std::string& name = "code", const std::string& suffix = ".plugin") {
        auto described = support::dataPlugIn(name);
        described.path = "/Applications/A.app/PlugIns/" + name + suffix;
        described.info = support::manifestOf(
            "com.example." + name, {{"VKExtensionProtocol", "Proto"}, {"VKExtensionAttributes", Dictionary()}});
        described.onSystemPartition = false;
        described.containingBundle = std::make_shared<ApplicationRecord>(
            ApplicationRecord{URL::file("/Applications/A.app"), "com.example.a", "A"});
        return support::proxyFor(described);
    }
    static void extend(PlugInProxy& proxy, const Dictionary& more) {
        auto extension = MutableDictionary::copyOf(*proxy.plugInDictionary);
        extension.merge(more);
        proxy.plugInDictionary = extension;
        proxy.infoDictionary = dictionaryChanging(proxy.infoDictionary, "VKExtension", extension);
    }
};

TEST_F(PlugIn, TakesItsFactsFromTheProxy) {
    auto proxy = code();
    proxy.localizedName = "Name";
    proxy.localizedShortName = "Short";
    proxy.originalIdentifier = "com.example.original";
    proxy.entitlements = Dictionary{{"true", true}, {"false", false}, {"zero", 0}, {"text", "NO"}, {"array", Array()}};
    const auto plugIn = make(proxy);
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->identifier(), Value("com.example.code"));
    EXPECT_EQ(plugIn->uuid(), proxy.uuid);
    EXPECT_EQ(plugIn->localizedName(), Value("Name"));
    EXPECT_EQ(plugIn->localizedShortName(), Value("Short"));
    EXPECT_EQ(plugIn->localizedContainingName(), Value("A"));
    EXPECT_EQ(plugIn->originalIdentifier(), Value("com.example.original"));
    EXPECT_EQ(plugIn->dataContainerURL(), proxy.dataContainerURL);
    EXPECT_EQ(plugIn->plugInDictionary(), proxy.plugInDictionary);
    EXPECT_EQ(plugIn->containingPath(), Value("/Applications/A.app"));
    EXPECT_FALSE(plugIn->onSystemVolume());
    EXPECT_EQ(plugIn->localizedFilevaneActionNames(), Dictionary());
    EXPECT_EQ(plugIn->entitlements(), proxy.entitlements);
    // Entitlements count unless they are false.
    for (const char* held : {"true", "text", "array"}) EXPECT_TRUE(plugIn->hasEntitlement(held)) << held;
    for (const char* lacking : {"false", "zero", "absent"}) EXPECT_FALSE(plugIn->hasEntitlement(lacking)) << lacking;
}

TEST_F(PlugIn, RegistrationDateIsTruncatedTowardZero) {
    for (const auto& [seconds, expected] : {std::pair{1.9, 1}, {-1.9, -1}, {0.0, 0}}) {
        auto proxy = data();
        proxy.registrationDate = Date{seconds};
        EXPECT_EQ(make(proxy)->lastModified(), expected);
    }
}

TEST_F(PlugIn, HubProtocolVersionIsStatedOrFollowsTheStyle) {
    for (const auto& [isStated, isOldStyle, version] :
         {std::tuple(true, true, 5U), {false, true, 1U}, {false, false, 2U}}) {
        auto proxy = data();
        if (isStated) extend(proxy, {{"HubProtocolVersion", 5}});
        if (isOldStyle) {
            auto info = MutableDictionary::copyOf(*proxy.infoDictionary);
            info.set("Zembra", Dictionary());
            proxy.infoDictionary = info;
        }
        EXPECT_EQ(make(proxy)->hubProtocolVersion(), version);
    }
}

TEST_F(PlugIn, MisconfiguredOnesAreRefusedWithTheirReason) {
    auto uncontained = code();
    uncontained.dataContainerURL.reset();
    auto outside = data();
    outside.bundleURL = URL::file("/SystemX/Library/data.plugin");
    auto principal = code("principal", ".appex");
    extend(principal, {{"PrincipalClass", "Other"}});
    for (const auto& [proxy, reason] : {std::pair(uncontained, "this plug-in has no sandbox data container"),
                                        {outside, "plug-ins outside containing apps must be in /System"},
                                        {principal, "Application Extensions may not use the \"PrincipalClass\" key"}}) {
        EXPECT_FALSE(make(proxy)) << reason;
        EXPECT_TRUE(
            logged(LogLevel::info, "ignoring mis-configured plug-in at " + proxy.bundleURL->path() + ": " + reason));
    }
    processLog.clear();
    auto proxy = data();
    proxy.dataContainerURL.reset(); // which plug-ins without code need not have
    EXPECT_TRUE(make(proxy));
    proxy.bundleURL.reset();
    EXPECT_FALSE(make(proxy));
    EXPECT_TRUE(processLog.messages("ops").empty());
    proxy = data();
    proxy.plugInIdentifier.reset();
    EXPECT_FALSE(make(proxy));
    EXPECT_TRUE(logged(LogLevel::error, "missing identifier in plug-in at " + proxy.bundleURL->path()));
}

TEST_F(PlugIn, ManifestFollowsTheRegistry) {
    auto proxy = data();
    const auto plugIn = make(proxy);
    const auto version = [&] { return plugIn->infoKey("VBBundleVersion"); };
    fake.registry.resetCalls();
    EXPECT_EQ(version(), Value("1"));
    EXPECT_EQ(plugIn->version(), Value("1.0"));
    EXPECT_EQ(fake.registry.calls("plugInForUUID"), 0) << "nothing changed since it was made";

    proxy.infoDictionary = dictionaryChanging(proxy.infoDictionary, "VBBundleVersion", "2");
    fake.registry.install(proxy);
    for (int i = 0; i < 2; ++i) EXPECT_EQ(version(), Value("2"));
    EXPECT_EQ(fake.registry.calls("plugInForUUID"), 1);

    // A registry that knows no knowledge UUID is asked each time.
    fake.registry.setKnowledgeUUID(std::nullopt);
    for (int i = 0; i < 2; ++i) version();
    EXPECT_EQ(fake.registry.calls("plugInForUUID"), 3);
}

TEST_F(PlugIn, GoneFromTheRegistryItKeepsItsFactsAndHasNoManifest) {
    const auto proxy = data();
    const auto plugIn = make(proxy);
    fake.registry.uninstall(*proxy.uuid);
    EXPECT_FALSE(plugIn->infoKey("VBBundleVersion"));
    EXPECT_TRUE(logged(LogLevel::error, "could not obtain fresh proxy for " + proxy.uuid->text()));
    EXPECT_TRUE(logged(LogLevel::standard,
                       "Failed to find Plugin by " + proxy.uuid->text() + " fallback to path " +
                           proxy.bundleURL->absoluteString(),
                       "cx"));
    EXPECT_FALSE(plugIn->version());
    EXPECT_EQ(plugIn->identifier(), Value("com.example.data"));
    fake.registry.install(proxy);
    EXPECT_EQ(plugIn->infoKey("VBBundleVersion"), Value("1"));
}

TEST_F(PlugIn, WithoutUUIDEachRecordHasItsOwnAndIsFoundByLocation) {
    auto proxy = data();
    proxy.uuid.reset();
    const auto first = make(proxy);
    const auto second = make(proxy);
    ASSERT_TRUE(first && second);
    EXPECT_NE(first->uuid(), second->uuid());
    EXPECT_EQ(first->infoKey("VBBundleVersion"), Value("1"));
}

TEST_F(PlugIn, KeptFormFollowsTheRegistryAndTokensAreIssuedEachTime) {
    for (const char* category : {"cx", "sandbox"}) processLog.setLevel(category, LogLevel::info);
    auto proxy = code("ext", ".appex");
    fake.sandbox.allowFile(proxy.bundleURL->path());
    fake.sandbox.services.insert("com.example.ext");
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
    for (const char* category : {"cx", "sandbox"}) processLog.setLevel(category, LogLevel::debug);
}

TEST_F(PlugIn, ActionNamesAreLocalizedOrThemselves) {
    auto proxy = data();
    const auto action = [](const char* name) { return Dictionary{{"VKExtensionFilevaneActionName", name}}; };
    extend(proxy, {{"VKExtensionFilevaneActions",
                    Array{action("turn"), action("turn"), action("flip"), Dictionary(), Value(3)}}});
    fake.registry.setStringTable(proxy.bundleURL->path(), "Localizable", {{"turn", "Drehen"}});
    EXPECT_EQ(make(proxy)->localizedFilevaneActionNames(), (Dictionary{{"turn", "Drehen"}, {"flip", "flip"}}));
    EXPECT_TRUE(logged(LogLevel::error, "missing VKExtensionFilevaneActionName for plugin ", "cx"));
}

TEST_F(PlugIn, PrunedDictionaryLosesBuildToolEntries) {
    EXPECT_EQ(ZBDPlugIn::prunedInfoDictionaryFor(Dictionary{{"DTBuild", 1}, {"DT", 2}, {"aDT", 3}, {"D", 4}}),
              (Dictionary{{"aDT", 3}, {"D", 4}}));
}

TEST_F(PlugIn, FormCarriesTheTokensThatTheSandboxGrants) {
    fake.sandbox.services.insert("com.example.code");
    auto proxy = code();
    const std::string path = proxy.bundleURL->path();
    const auto sharing = [&](const Value& shared) {
        extend(proxy, {{"Shared", shared}});
        return augmented(proxy);
    };
    EXPECT_FALSE(augmented(proxy).contains("extensions")) << "nothing is shared";
    for (const char* file : {"", "/Fonts"}) fake.sandbox.allowFile(path + file);
    fake.sandbox.files[path + "/link"] = "/etc/passwd";

    const auto form = sharing(Array{"Fonts", 7, "Sounds", ".", "link"});
    std::vector<std::string> resources;
    const Dictionary extensions = *form.dictionary("extensions");
    for (const auto& entry : extensions) resources.emplace_back(entry.name());
    EXPECT_EQ(resources, (std::vector<std::string>{"Fonts", "."}));
    EXPECT_TRUE(form.contains("service-extension"));
    EXPECT_TRUE(logged(LogLevel::info, "failed to make extension for " + path + "/Sounds in plug-in at " + path +
                                           ": Operation not permitted"));
    EXPECT_EQ(sharing("Fonts").dictionary("extensions")->size(), 1U);
    EXPECT_EQ(sharing(Array()).dictionary("extensions"), Dictionary());

    fake.sandbox.services.clear();
    EXPECT_FALSE(augmented(proxy).contains("service-extension"));
    EXPECT_TRUE(logged(LogLevel::info, "failed to make mach extension for com.example.code in plug-in at " + path +
                                           ": Operation not permitted"));
    fake.sandbox.services.insert("com.example.data");
    EXPECT_TRUE(augmented(data()).empty()) << "without code there is no service";
}

TEST_F(PlugIn, ApplicationExtensionSharesItsWholeBundle) {
    auto proxy = code("ext", ".appex");
    for (const char* file : {"", "/Fonts"}) fake.sandbox.allowFile(proxy.bundleURL->path() + file);
    extend(proxy, {{"Shared", Array{"Fonts"}}});
    const auto extensions = *augmented(proxy).dictionary("extensions");
    EXPECT_EQ(extensions.size(), 1U);
    EXPECT_TRUE(extensions.contains("."));
}

} // namespace
