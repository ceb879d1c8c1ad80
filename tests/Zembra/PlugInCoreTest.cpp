#include "Zembra/ZBPlugInCore.h"
#include "tests/support/RegistryFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>
#include <unordered_set>

namespace {

using namespace platform;
using support::logged;
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
        EXPECT_FALSE(ZBPlugInCore::initWithName("org.example.share", extensionURL, info, Dictionary(), std::nullopt));
        EXPECT_TRUE(logged(LogLevel::standard, "malformed plug-in dictionary in plug-in org.example.share at " +
                                                   extensionURL.absoluteString() + ": " + info.description()));
    }
    processLog.clear();
    EXPECT_EQ(ZBPlugInCore::initWithName(Value(), std::nullopt, Value(), Value(), std::nullopt), nullptr);
    EXPECT_TRUE(processLog.lines().empty());
    EXPECT_EQ(ZBPlugInCore::initWithName(Value(), extensionURL, Value(), Value(), std::nullopt), nullptr);
    EXPECT_TRUE(logged(LogLevel::error, "missing identifier in plug-in at " + extensionURL.path()));
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
    EXPECT_TRUE(logged(LogLevel::standard, "multiplexed plug-ins (Multiple key) obsolete and ignored"));

    // The plug-in dictionary that is given along counts only where bundle info leaves none.
    for (const Value& info : {Value(), Value(Dictionary{{"VKExtension", extension}})}) {
        const auto made = ZBPlugInCore::initWithName("a", extensionURL, info, withoutExtension, std::nullopt);
        EXPECT_TRUE(made->plugInDictionary()->sharesStorageWith(info ? extension : withoutExtension));
        EXPECT_EQ(made->bundleInfoDictionary().has_value(), static_cast<bool>(info));
    }
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
    const auto with = recordAt(extensionURL, {});
    const ZBPlugInCore without;
    EXPECT_FALSE(*with == without);
    processLog.print();
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
    processLog.print();
    EXPECT_DEATH((void)plugIn.oldStyle(), "unknown plug-in configuration style");
}

TEST(DerivedProperties, AppExtensionsHaveDefaults) {
    const auto extension = recordAt(extensionURL, {});
    EXPECT_TRUE(extension->isAppExtension());
    for (const Value& point :
         {extension->protocolSpec(), extension->principalSpec(), extension->embeddedProtocolSpec()}) {
        EXPECT_EQ(point, Value("VKObject"));
    }
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
    const auto fault = [](const char* text) { return Error{"Zembra", 12, text}; };
    const auto attributed = [](const Dictionary& more) {
        MutableDictionary plugIn{{"VKExtensionAttributes", Dictionary()}};
        plugIn.merge(more);
        return plugIn;
    };
    const char* const unproxied = "the \"PassProxy\" key is not supported on this platform";
    const struct {
        URL url;
        Dictionary plugIn;
        Failure expected;
    } cases[] = {
        {extensionURL, attributed({}), std::nullopt},
        {extensionURL, attributed({{"PrincipalClass", "VKObject"}}), std::nullopt},
        {otherURL, attributed({{"VKExtensionProtocol", "P"}, {"PrincipalClass", "C"}}), std::nullopt},
        {otherURL, {{"PassProxy", true}}, fault("missing \"VKExtensionProtocol\" key in Info.vlist or SDK")},
        {extensionURL, {{"PassProxy", true}}, fault("missing \"VKExtensionAttributes\" key in Info.vlist or SDK")},
        {extensionURL, attributed({{"PrincipalClass", "C"}, {"PassProxy", true}}),
         fault("Application Extensions may not use the \"PrincipalClass\" key")},
        {extensionURL, attributed({{"PassProxy", false}, {"EmbeddedCode", true}}), fault(unproxied)},
        {extensionURL, attributed({{"EmbeddedCode", false}}),
         fault("hybrid plug-ins are not supported on this platform")},
    };
    for (const auto& each : cases) {
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
    for (const char* version : {"2.5", "3"}) { // the second comes too late
        plugIn->setBundleInfoDictionary(Dictionary{{"VBBundleShortVersionString", version}});
        plugIn->canonicalize();
        EXPECT_EQ(plugIn->version().string(), "2.5");
    }
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
    const struct {
        const char* key;
        Value sdk, plugIn, merged;
    } cases[] = {
        {"CleanTimeout", 9, 1, 9},
        {"Shared", Array{"Fonts", "Sounds"}, Array{"Icons", "Fonts"}, Array{"Icons", "Fonts", "Sounds"}},
        {"Shared", Array{"Fonts"}, ".", "."},
        {"New", "sdk", {}, "sdk"},
        {"Text", "sdk", "own", "own"},
        {"Mixed", Dictionary{{"a", 1}}, "own", "own"},
    };
    for (const auto& each : cases) {
        MutableDictionary sdk{{each.key, each.sdk}};
        MutableDictionary plugIn;
        if (each.plugIn) plugIn.set(each.key, each.plugIn);
        const Dictionary merged{{each.key, each.merged}};
        EXPECT_EQ(ZBPlugInCore::mergeDictionary(sdk, plugIn), merged) << each.key;
        EXPECT_EQ(ZBPlugInCore::mergeDictionary({{"Nested", sdk}}, {{"Nested", plugIn}}),
                  (Dictionary{{"Nested", merged}}));
        EXPECT_EQ(sdk[each.key], each.sdk);
        EXPECT_EQ(plugIn[each.key], each.plugIn);
    }
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
    unknown->resolveSDK(registry);
    EXPECT_TRUE(logged(LogLevel::standard, "plug-in sdk \"org.example.unknown\" not registered"));
    EXPECT_EQ(unknown->version().string(), "1");
    const auto odd = recordAt(otherURL, {{"VKExtensionPointIdentifier", 5}});
    odd->resolveSDK(registry);
    EXPECT_FALSE(odd->attributes());
    EXPECT_TRUE(logged(LogLevel::error, "invalid SDK key:5"));
    const int asked = registry.calls("sdkDictionary");
    recordAt(otherURL, {})->resolveSDK(registry);
    EXPECT_EQ(registry.calls("sdkDictionary"), asked);
}

} // namespace
