#include "Zembra/ZBPlugInCore.h"
#include "tests/support/RegistryFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>
#include <unordered_set>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::Failure;
using platform::LogLevel;
using platform::MutableDictionary;
using platform::URL;
using platform::UUID;
using platform::Value;
using support::processLog;
using zembra::ZBPlugInCore;

const URL extensionURL = URL::file("/Applications/App.app/PlugIns/Share.appex");
const URL otherURL = URL::file("/System/Library/PlugIns/Share.APPEX");

std::shared_ptr<ZBPlugInCore> recordAt(const URL& url, const Dictionary& plugInDictionary) {
    return ZBPlugInCore::initWithName("org.example.share", url, Dictionary{{"VKExtension", plugInDictionary}}, Value(),
                                      std::nullopt);
}

TEST(InitWithName, RefusesUnusableBundleInfo) {
    for (const Value& info :
         {Value(Array()), Value("text"), Value(Dictionary()), Value(Dictionary{{"VKExtension", "text"}}),
          Value(Dictionary{{"VKExtension", Array()}})}) {
        processLog.clear();
        EXPECT_EQ(ZBPlugInCore::initWithName("org.example.share", extensionURL, info, Dictionary(), std::nullopt),
                  nullptr);
        EXPECT_TRUE(processLog.contains(LogLevel::standard, "ops",
                                        "malformed plug-in dictionary in plug-in org.example.share at " +
                                            extensionURL.absoluteString() + ": " + info.description()))
            << info.description();
    }
    processLog.clear();
    EXPECT_EQ(ZBPlugInCore::initWithName(Value(), std::nullopt, Value(), Value(), std::nullopt), nullptr);
    EXPECT_TRUE(processLog.lines().empty());
    EXPECT_EQ(ZBPlugInCore::initWithName(Value(), extensionURL, Value(), Value(), std::nullopt), nullptr);
    EXPECT_TRUE(processLog.contains(LogLevel::error, "ops", "missing identifier in plug-in at " + extensionURL.path()));
}

TEST(SetDictionaries, StoresWhatItAccepted) {
    ZBPlugInCore plugIn;
    EXPECT_FALSE(plugIn.setDictionaries(Array()));
    EXPECT_FALSE(plugIn.bundleInfoDictionary());
    const Dictionary withoutExtension{{"VBBundleName", "Share"}};
    EXPECT_FALSE(plugIn.setDictionaries(withoutExtension));
    EXPECT_TRUE(plugIn.bundleInfoDictionary()->sharesStorageWith(withoutExtension));
    EXPECT_FALSE(plugIn.plugInDictionary());
    const Dictionary extension{{"Multiple", false}};
    EXPECT_TRUE(plugIn.setDictionaries(Dictionary{{"VKExtension", extension}}));
    EXPECT_TRUE(plugIn.plugInDictionary()->sharesStorageWith(extension));
    EXPECT_TRUE(
        processLog.contains(LogLevel::standard, "ops", "multiplexed plug-ins (Multiple key) obsolete and ignored"));
}

TEST(InitWithName, TakesInfoOnlyWhereBundleInfoLeavesNoPlugInDictionary) {
    const Dictionary info{{"Dedicated", true}};
    const auto bare = ZBPlugInCore::initWithName("org.example.share", extensionURL, Value(), info, std::nullopt);
    EXPECT_TRUE(bare->plugInDictionary()->sharesStorageWith(info));
    EXPECT_FALSE(bare->bundleInfoDictionary());
    const auto full = ZBPlugInCore::initWithName("org.example.share", extensionURL,
                                                 Dictionary{{"VKExtension", Dictionary()}}, info, std::nullopt);
    EXPECT_EQ(full->plugInDictionary(), Dictionary());
}

TEST(Equality, IsByUuid) {
    const auto make = [](const char* identifier, const std::optional<UUID>& uuid) {
        return ZBPlugInCore::initWithName(identifier, extensionURL, Value(), Value(), uuid);
    };
    const UUID uuid = UUID::random();
    const auto first = make("org.example.a", uuid);
    const auto same = make("org.example.b", uuid);
    EXPECT_EQ(*first, *same);
    EXPECT_EQ(first->hash(), same->hash());
    EXPECT_NE(*make("org.example.a", std::nullopt), *make("org.example.a", std::nullopt));

    std::unordered_set<std::shared_ptr<ZBPlugInCore>, zembra::ZBPlugInHash, zembra::ZBPlugInEqual> set{first};
    EXPECT_TRUE(set.contains(same));
    EXPECT_FALSE(set.contains(make("org.example.a", std::nullopt)));
}

TEST(EqualityDeathTest, WithoutUuidStopsTheProcess) {
    const auto with = ZBPlugInCore::initWithName("org.example.a", extensionURL, Value(), Value(), std::nullopt);
    const ZBPlugInCore without;
    EXPECT_FALSE(*with == without);
    support::processLog.print();
    EXPECT_DEATH((void)without.isEqual(*with), "self.uuid");
    EXPECT_DEATH((void)without.hash(), "self.uuid");
}

TEST(OldStyleDeathTest, FollowsTheManifestDictionary) {
    ZBPlugInCore plugIn;
    plugIn.setBundleInfoDictionary(Dictionary{{"VKExtension", Dictionary()}, {"Zembra", Dictionary()}});
    EXPECT_FALSE(plugIn.oldStyle());
    plugIn.setBundleInfoDictionary(Dictionary{{"Zembra", Dictionary()}});
    EXPECT_TRUE(plugIn.oldStyle());
    plugIn.setBundleInfoDictionary(Dictionary());
    support::processLog.print();
    EXPECT_DEATH((void)plugIn.oldStyle(), "unknown plug-in configuration style");
}

TEST(InfoKey, IsTraced) {
    const auto plugIn = ZBPlugInCore::initWithName("org.example.share", extensionURL,
                                                   Dictionary{{"VKExtension", Dictionary()}, {"VBBundleName", "Share"}},
                                                   Value(), std::nullopt);
    processLog.clear();
    EXPECT_EQ(plugIn->infoKey("VBBundleName").string(), "Share");
    EXPECT_FALSE(plugIn->infoKey("Other"));
    EXPECT_EQ(processLog.messages("cx"),
              (std::vector<std::string>{"infoKey VBBundleName => Share", "infoKey Other => (null)"}));
}

TEST(DerivedProperties, AppExtensionsHaveDefaults) {
    const auto extension = recordAt(extensionURL, {});
    EXPECT_TRUE(extension->isAppExtension());
    EXPECT_EQ(extension->protocolSpec().string(), "VKObject");
    EXPECT_EQ(extension->principalSpec().string(), "VKObject");
    EXPECT_EQ(extension->embeddedProtocolSpec().string(), "VKObject");
    const auto other = recordAt(otherURL, {});
    EXPECT_FALSE(other->isAppExtension());
    EXPECT_FALSE(other->protocolSpec());
    EXPECT_FALSE(other->principalSpec());
}

TEST(DerivedProperties, ReadTheManifest) {
    const auto plugIn = recordAt(otherURL, {{"VKExtensionProtocol", "#Data"},
                                            {"EmbeddedProtocol", "Inner"},
                                            {"Dedicated", 1},
                                            {"EmbeddedCode", false},
                                            {"VKExtensionAttributes", Dictionary{{"VKExtensionVersion", "3"}}}});
    EXPECT_TRUE(plugIn->isData());
    EXPECT_TRUE(plugIn->isDedicated());
    EXPECT_TRUE(plugIn->isHybrid());
    EXPECT_EQ(plugIn->embeddedProtocolSpec().string(), "Inner");
    EXPECT_EQ(plugIn->version().string(), "3");
    EXPECT_FALSE(recordAt(otherURL, {{"VKExtensionProtocol", Array{"#Data"}}})->isData());
    EXPECT_FALSE(recordAt(otherURL, {{"Dedicated", "yes"}})->isDedicated());
    EXPECT_FALSE(recordAt(otherURL, {{"VKExtensionAttributes", "odd"}})->attribute("VKExtensionVersion"));
}

TEST(Diagnose, AnswersTheFirstFault) {
    struct Case {
        URL url;
        Dictionary plugIn;
        Failure expected;
    };
    const auto fault = [](const char* text) { return platform::Error{"Zembra", 12, text}; };
    const Value attributes = Dictionary();
    const std::vector<Case> cases = {
        {extensionURL, {{"VKExtensionAttributes", attributes}}, std::nullopt},
        {otherURL,
         {{"VKExtensionAttributes", attributes}, {"VKExtensionProtocol", "P"}, {"PrincipalClass", "C"}},
         std::nullopt},
        {extensionURL, {{"VKExtensionAttributes", attributes}, {"PrincipalClass", "VKObject"}}, std::nullopt},
        {otherURL, {{"PassProxy", true}}, fault("missing \"VKExtensionProtocol\" key in Info.vlist or SDK")},
        {extensionURL, {{"PassProxy", true}}, fault("missing \"VKExtensionAttributes\" key in Info.vlist or SDK")},
        {extensionURL,
         {{"VKExtensionAttributes", attributes}, {"PrincipalClass", "C"}, {"PassProxy", true}},
         fault("Application Extensions may not use the \"PrincipalClass\" key")},
        {extensionURL,
         {{"VKExtensionAttributes", attributes}, {"PassProxy", false}, {"EmbeddedCode", true}},
         fault("the \"PassProxy\" key is not supported on this platform")},
        {extensionURL,
         {{"VKExtensionAttributes", attributes}, {"EmbeddedCode", false}},
         fault("hybrid plug-ins are not supported on this platform")},
    };
    for (const Case& each : cases) {
        EXPECT_EQ(recordAt(each.url, each.plugIn)->diagnose(), each.expected) << Value(each.plugIn).description();
    }
    EXPECT_EQ(ZBPlugInCore().diagnose(),
              fault("missing identifier (no VKExtensionIdentifier, nor even VBBundleIdentifier)"));
}

TEST(Canonicalize, FillsInAttributesAndVersion) {
    const Dictionary bare{{"Dedicated", true}};
    const auto plugIn = recordAt(extensionURL, bare);
    plugIn->canonicalize();
    EXPECT_EQ(plugIn->attributes(), (Dictionary{{"VKExtensionVersion", "1"}}));
    EXPECT_TRUE(plugIn->isDedicated());
    EXPECT_EQ(bare, (Dictionary{{"Dedicated", true}})); // the manifest itself is not touched

    plugIn->setPlugInDictionary(Dictionary());
    plugIn->setBundleInfoDictionary(Dictionary{{"VBBundleShortVersionString", "2.5"}});
    plugIn->canonicalize();
    EXPECT_EQ(plugIn->version().string(), "2.5");
    plugIn->setBundleInfoDictionary(Dictionary{{"VBBundleShortVersionString", "3"}});
    plugIn->canonicalize();
    EXPECT_EQ(plugIn->version().string(), "2.5");
}

TEST(Annotations, ChangeInANewDictionary) {
    const auto plugIn = recordAt(extensionURL, {});
    plugIn->setAnnotation("election", 1);
    EXPECT_FALSE(plugIn->annotations());

    const Dictionary before{{"election", 0}};
    plugIn->setAnnotations(before);
    MutableDictionary extension;
    plugIn->setAnnotation("extension", extension);
    extension.set("later", true);
    EXPECT_EQ(plugIn->annotations(), (Dictionary{{"election", 0}, {"extension", Dictionary()}}));
    plugIn->setAnnotation("election", Value());
    EXPECT_EQ(plugIn->annotations(), (Dictionary{{"extension", Dictionary()}}));
    EXPECT_EQ(before, (Dictionary{{"election", 0}}));
    plugIn->updateFromForm({{"annotations", Dictionary{{"election", 2}}}, {"identifier", "other"}});
    EXPECT_EQ(plugIn->annotations(), (Dictionary{{"election", 2}}));
    EXPECT_EQ(plugIn->identifier().string(), "org.example.share");
    plugIn->updateFromForm({});
    EXPECT_FALSE(plugIn->annotations());
}

TEST(MergeDictionary, PlugInWinsExceptForTheRules) {
    const Dictionary sdk{{"CleanTimeout", 9},
                         {"Shared", Array{"Fonts", "Sounds"}},
                         {"New", "sdk"},
                         {"Text", "sdk"},
                         {"Nested", Dictionary{{"CleanTimeout", 8}, {"Text", "sdk"}, {"New", "sdk"}}},
                         {"Mixed", Dictionary{{"a", 1}}}};
    const Dictionary plugIn{{"CleanTimeout", 1},
                            {"Shared", Array{"Icons", "Fonts"}},
                            {"Text", "own"},
                            {"Nested", Dictionary{{"CleanTimeout", 2}, {"Text", "own"}}},
                            {"Mixed", "own"}};
    const Dictionary sdkBefore = MutableDictionary::copyOf(sdk);
    const Dictionary plugInBefore = MutableDictionary::copyOf(plugIn);
    EXPECT_EQ(ZBPlugInCore::mergeDictionary(sdk, plugIn),
              (Dictionary{{"CleanTimeout", 9},
                          {"Shared", Array{"Icons", "Fonts", "Sounds"}},
                          {"New", "sdk"},
                          {"Text", "own"},
                          {"Nested", Dictionary{{"CleanTimeout", 8}, {"Text", "own"}, {"New", "sdk"}}},
                          {"Mixed", "own"}}));
    EXPECT_EQ(sdk, sdkBefore);
    EXPECT_EQ(plugIn, plugInBefore);
    EXPECT_EQ(ZBPlugInCore::mergeDictionary({{"Shared", Array{"Fonts"}}}, {{"Shared", "."}}),
              (Dictionary{{"Shared", "."}}));
}

TEST(ResolveSDK, MergesAndCanonicalizes) {
    support::FakeRegistry registry;
    registry.setSDKDictionary("org.example.point",
                              {{"VKExtension", Dictionary{{"VKExtensionProtocol", "Sharing"}, {"Dedicated", true}}}});
    const auto known = recordAt(otherURL, {{"VKExtensionPointIdentifier", "org.example.point"}, {"Dedicated", false}});
    known->resolveSDK(registry);
    EXPECT_EQ(known->protocolSpec().string(), "Sharing");
    EXPECT_FALSE(known->isDedicated());
    EXPECT_EQ(known->version().string(), "1");

    const auto unknown = recordAt(otherURL, {{"VKExtensionPointIdentifier", "org.example.unknown"}});
    processLog.clear();
    unknown->resolveSDK(registry);
    EXPECT_TRUE(processLog.contains(LogLevel::standard, "ops", "plug-in sdk \"org.example.unknown\" not registered"));
    EXPECT_EQ(unknown->version().string(), "1");
    const auto odd = recordAt(otherURL, {{"VKExtensionPointIdentifier", 5}});
    odd->resolveSDK(registry);
    EXPECT_FALSE(odd->attributes());
    EXPECT_TRUE(processLog.contains(LogLevel::error, "ops", "invalid SDK key:5"));
    const int asked = registry.calls("sdkDictionary");
    recordAt(otherURL, {})->resolveSDK(registry);
    EXPECT_EQ(registry.calls("sdkDictionary"), asked);
}

} // namespace
