#include "tests/support/FakePlatform.h"
#include "zbd/ZBDPlugIn.h"

#include <gtest/gtest.h>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::LogLevel;
using platform::PlugInProxy;
using platform::URL;
using platform::Value;
using support::processLog;
using zbd::ZBDPlugIn;

struct PlugIn : testing::Test {
    support::FakePlatform fake;

    std::shared_ptr<ZBDPlugIn> make(PlugInProxy proxy) {
        return ZBDPlugIn::initWithCXData(fake.platform, fake.registry.install(std::move(proxy)));
    }
    static PlugInProxy data(const std::string& name = "data") { return support::proxyFor(support::dataPlugIn(name)); }
    /// A plug-in with code, in an application.
    static PlugInProxy code(const std::string& name = "code", const std::string& suffix = ".plugin") {
        auto described = support::dataPlugIn(name);
        described.path = "/Applications/A.app/PlugIns/" + name + suffix;
        described.info = support::manifestOf(
            "com.example." + name, {{"VKExtensionProtocol", "Proto"}, {"VKExtensionAttributes", Dictionary()}});
        described.onSystemPartition = false;
        described.containingBundle = std::make_shared<platform::ApplicationRecord>(
            platform::ApplicationRecord{URL::file("/Applications/A.app"), "com.example.a", "A"});
        return support::proxyFor(described);
    }
    void expectRefused(PlugInProxy proxy, const std::string& reason) {
        processLog.clear();
        const std::string path = proxy.bundleURL->path();
        EXPECT_FALSE(make(std::move(proxy))) << reason;
        EXPECT_TRUE(
            processLog.contains(LogLevel::info, "ops", "ignoring mis-configured plug-in at " + path + ": " + reason))
            << reason;
    }
};

TEST_F(PlugIn, TakesItsFactsFromTheProxy) {
    auto proxy = code();
    proxy.localizedName = "Name";
    proxy.localizedShortName = "Short";
    proxy.originalIdentifier = "com.example.original";
    proxy.entitlements = Dictionary{{"e", true}};
    const auto plugIn = make(proxy);
    ASSERT_TRUE(plugIn);
    EXPECT_EQ(plugIn->identifier(), Value("com.example.code"));
    EXPECT_EQ(plugIn->uuid(), proxy.uuid);
    EXPECT_EQ(plugIn->localizedName(), Value("Name"));
    EXPECT_EQ(plugIn->localizedShortName(), Value("Short"));
    EXPECT_EQ(plugIn->localizedContainingName(), Value("A"));
    EXPECT_EQ(plugIn->originalIdentifier(), Value("com.example.original"));
    EXPECT_EQ(plugIn->entitlements(), (Dictionary{{"e", true}}));
    EXPECT_EQ(plugIn->dataContainerURL(), proxy.dataContainerURL);
    EXPECT_EQ(plugIn->plugInDictionary(), proxy.plugInDictionary);
    EXPECT_EQ(plugIn->containingPath(), Value("/Applications/A.app"));
    EXPECT_FALSE(plugIn->onSystemVolume());
    EXPECT_EQ(plugIn->localizedFilevaneActionNames(), Dictionary());
}

TEST_F(PlugIn, RegistrationDateIsTruncatedTowardZero) {
    for (const auto& [seconds, expected] : {std::pair{1.9, 1}, {-1.9, -1}, {0.0, 0}}) {
        auto proxy = data();
        proxy.registrationDate = platform::Date{seconds};
        EXPECT_EQ(make(proxy)->lastModified(), expected);
    }
}

TEST_F(PlugIn, HubProtocolVersionIsStatedOrFollowsTheStyle) {
    struct Case {
        Dictionary stated;
        bool oldStyle;
        std::uint64_t version;
    };
    for (const Case& c : {Case{{{"HubProtocolVersion", 5}}, true, 5}, Case{{}, true, 1}, Case{{}, false, 2}}) {
        auto proxy = data();
        auto extension = platform::MutableDictionary::copyOf(*proxy.plugInDictionary);
        extension.merge(c.stated);
        auto info = platform::MutableDictionary::copyOf(*proxy.infoDictionary);
        if (c.oldStyle) info.set("Zembra", Dictionary());
        proxy.plugInDictionary = extension;
        proxy.infoDictionary = info;
        EXPECT_EQ(make(proxy)->hubProtocolVersion(), c.version);
    }
}

TEST_F(PlugIn, WithoutLocationOrIdentifierThereIsNone) {
    auto proxy = data();
    proxy.bundleURL.reset();
    EXPECT_FALSE(make(proxy));
    EXPECT_TRUE(processLog.messages("ops").empty());
    proxy = data();
    proxy.plugInIdentifier.reset();
    EXPECT_FALSE(make(proxy));
    EXPECT_TRUE(
        processLog.contains(LogLevel::error, "ops", "missing identifier in plug-in at " + proxy.bundleURL->path()));
}

TEST_F(PlugIn, MisconfiguredOnesAreRefusedWithTheirReason) {
    auto proxy = code();
    proxy.dataContainerURL.reset();
    expectRefused(proxy, "this plug-in has no sandbox data container");

    proxy = data();
    proxy.bundleURL = URL::file("/SystemX/Library/data.plugin");
    expectRefused(proxy, "plug-ins outside containing apps must be in /System");

    auto principal = code("principal", ".appex");
    auto info = platform::MutableDictionary::copyOf(*principal.infoDictionary);
    info.set("VKExtension", Dictionary{{"PrincipalClass", "Other"}, {"VKExtensionAttributes", Dictionary()}});
    principal.infoDictionary = info;
    expectRefused(principal, "Application Extensions may not use the \"PrincipalClass\" key");

    auto container = data("contained"); // a data-only plug-in needs no container
    container.dataContainerURL.reset();
    EXPECT_TRUE(make(container));
}

TEST_F(PlugIn, ManifestFollowsTheRegistry) {
    auto proxy = data();
    const auto plugIn = make(proxy);
    fake.registry.resetCalls();
    EXPECT_EQ(plugIn->infoKey("VBBundleVersion"), Value("1"));
    EXPECT_EQ(plugIn->version(), Value("1.0"));
    EXPECT_EQ(fake.registry.calls("plugInForUUID"), 0) << "nothing changed since it was made";

    auto info = platform::MutableDictionary::copyOf(*proxy.infoDictionary);
    info.set("VBBundleVersion", "2");
    proxy.infoDictionary = info;
    fake.registry.install(proxy);
    EXPECT_EQ(plugIn->infoKey("VBBundleVersion"), Value("2"));
    EXPECT_EQ(plugIn->infoKey("VBBundleVersion"), Value("2"));
    EXPECT_EQ(fake.registry.calls("plugInForUUID"), 1);

    // A registry that knows no knowledge UUID is asked each time.
    fake.registry.setKnowledgeUUID(std::nullopt);
    plugIn->infoKey("x");
    plugIn->infoKey("x");
    EXPECT_EQ(fake.registry.calls("plugInForUUID"), 3);
}

TEST_F(PlugIn, GoneFromTheRegistryItKeepsItsFactsAndHasNoManifest) {
    auto proxy = data();
    const auto plugIn = make(proxy);
    fake.registry.uninstall(*proxy.uuid);
    EXPECT_FALSE(plugIn->infoKey("VBBundleVersion"));
    EXPECT_TRUE(processLog.contains(LogLevel::error, "ops", "could not obtain fresh proxy for " + proxy.uuid->text()));
    EXPECT_TRUE(processLog.contains(LogLevel::standard, "cx",
                                    "Failed to find Plugin by " + proxy.uuid->text() + " fallback to path " +
                                        proxy.bundleURL->absoluteString()));
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
    EXPECT_TRUE(processLog.contains(LogLevel::standard, "cx",
                                    "Failed to find Plugin by " + first->uuid()->text() + " fallback to path " +
                                        proxy.bundleURL->absoluteString()));
}

TEST_F(PlugIn, KeptFormAndTokensFollowTheRegistry) {
    for (const char* category : {"cx", "sandbox"}) processLog.setLevel(category, LogLevel::info);
    auto proxy = code("ext", ".appex");
    fake.sandbox.allowFile(proxy.bundleURL->path());
    fake.sandbox.services.insert("com.example.ext");
    const auto plugIn = make(proxy);
    const auto form = [&] {
        auto current = plugIn->currentForm(nullptr);
        plugIn->augmentForm(current);
        return current;
    };
    const auto first = form();
    auto second = form();
    EXPECT_EQ(first, second);
    EXPECT_EQ(first, [&] {
        auto exported = plugIn->exportForm(nullptr);
        plugIn->augmentForm(exported);
        return exported;
    }());
    second.set("identifier", "changed");
    EXPECT_EQ(form(), first) << "each caller has its own";

    fake.sandbox.issueError = 13; // kept tokens are not asked for again, until the registry knows more
    EXPECT_EQ(form(), first);
    auto info = platform::MutableDictionary::copyOf(*proxy.infoDictionary);
    info.set("VBBundleVersion", "2");
    proxy.infoDictionary = info;
    fake.registry.install(proxy);
    const auto third = form();
    EXPECT_EQ(third.dictionary("bundleInfo")->string("VBBundleVersion"), "2");
    EXPECT_EQ(third.dictionary("extensions"), Dictionary());
    plugIn->setLocalizedName("Neu");
    EXPECT_EQ(form()["localizedDisplayName"], Value("Neu"));
    for (const char* category : {"cx", "sandbox"}) processLog.setLevel(category, LogLevel::debug);
}

TEST_F(PlugIn, EntitlementsCountUnlessFalse) {
    auto proxy = data();
    proxy.entitlements = Dictionary{{"true", true}, {"false", false}, {"zero", 0}, {"text", "NO"}, {"array", Array()}};
    const auto plugIn = make(proxy);
    for (const char* held : {"true", "text", "array"}) EXPECT_TRUE(plugIn->hasEntitlement(held)) << held;
    for (const char* lacking : {"false", "zero", "absent"}) EXPECT_FALSE(plugIn->hasEntitlement(lacking)) << lacking;
}

TEST_F(PlugIn, ActionNamesAreLocalizedOrThemselves) {
    auto proxy = data();
    auto extension = platform::MutableDictionary::copyOf(*proxy.plugInDictionary);
    extension.set("VKExtensionFilevaneActions",
                  Array{Dictionary{{"VKExtensionFilevaneActionName", "turn"}},
                        Dictionary{{"VKExtensionFilevaneActionName", "turn"}},
                        Dictionary{{"VKExtensionFilevaneActionName", "flip"}}, Dictionary(), Value(3)});
    proxy.plugInDictionary = extension;
    fake.registry.setStringTable(proxy.bundleURL->path(), "Localizable", {{"turn", "Drehen"}});
    const auto plugIn = make(proxy);
    EXPECT_EQ(plugIn->localizedFilevaneActionNames(), (Dictionary{{"turn", "Drehen"}, {"flip", "flip"}}));
    int nameless = 0;
    for (const auto& line : processLog.lines()) {
        nameless += line.level == LogLevel::error && line.category == "cx" &&
                    line.message.starts_with("missing VKExtensionFilevaneActionName for plugin ");
    }
    EXPECT_EQ(nameless, 2);
}

TEST_F(PlugIn, PrunedDictionaryLosesBuildToolEntries) {
    EXPECT_EQ(ZBDPlugIn::prunedInfoDictionaryFor(Dictionary{{"DTBuild", 1}, {"DT", 2}, {"aDT", 3}, {"D", 4}}),
              (Dictionary{{"aDT", 3}, {"D", 4}}));
}

TEST_F(PlugIn, FormCarriesTheTokensThatTheSandboxGrants) {
    fake.sandbox.services.insert("com.example.code");
    auto proxy = code();
    const std::string path = proxy.bundleURL->path();
    const auto share = [&](const Value& shared) {
        auto extension = platform::MutableDictionary::copyOf(*proxy.plugInDictionary);
        extension.set("VKExtensionAttributes", Dictionary());
        if (shared) extension.set("Shared", shared);
        auto info = platform::MutableDictionary::copyOf(*proxy.infoDictionary);
        info.set("VKExtension", extension);
        proxy.infoDictionary = info;
        platform::MutableDictionary form;
        make(proxy)->augmentForm(form);
        return form;
    };
    fake.sandbox.allowFile(path);
    fake.sandbox.allowFile(path + "/Fonts");
    fake.sandbox.files[path + "/link"] = "/etc/passwd";

    const auto form = share(Array{"Fonts", 7, "Sounds", ".", "link"});
    std::vector<std::string> resources;
    const Dictionary extensions = *form.dictionary("extensions");
    for (const auto& entry : extensions) resources.emplace_back(entry.name());
    EXPECT_EQ(resources, (std::vector<std::string>{"Fonts", "."}));
    EXPECT_TRUE(form.contains("service-extension"));
    EXPECT_TRUE(processLog.contains(LogLevel::info, "ops",
                                    "failed to make extension for " + path + "/Sounds in plug-in at " + path +
                                        ": Operation not permitted"));

    EXPECT_EQ(share("Fonts").dictionary("extensions")->size(), 1U);
    EXPECT_EQ(share(Array()).dictionary("extensions"), Dictionary());
    EXPECT_FALSE(share(Value()).contains("extensions"));

    fake.sandbox.services.clear();
    EXPECT_FALSE(share(Value()).contains("service-extension"));
    EXPECT_TRUE(processLog.contains(LogLevel::info, "ops",
                                    "failed to make mach extension for com.example.code in plug-in at " + path +
                                        ": Operation not permitted"));
}

TEST_F(PlugIn, ApplicationExtensionSharesItsWholeBundle) {
    auto proxy = code("ext", ".appex");
    const std::string path = proxy.bundleURL->path();
    for (const char* file : {"", "/Fonts", "/Sounds"}) fake.sandbox.allowFile(path + file);
    auto info = platform::MutableDictionary::copyOf(*proxy.infoDictionary);
    info.set("VKExtension", Dictionary{{"VKExtensionAttributes", Dictionary()}, {"Shared", Array{"Fonts", "Sounds"}}});
    proxy.infoDictionary = info;
    platform::MutableDictionary form;
    make(proxy)->augmentForm(form);
    ASSERT_EQ(form.dictionary("extensions")->size(), 1U);
    EXPECT_TRUE(form.dictionary("extensions")->contains("."));
}

TEST_F(PlugIn, DataOnlyFormHasNoServiceToken) {
    fake.sandbox.services.insert("com.example.data");
    platform::MutableDictionary form;
    make(data())->augmentForm(form);
    EXPECT_TRUE(form.empty());
}

} // namespace
