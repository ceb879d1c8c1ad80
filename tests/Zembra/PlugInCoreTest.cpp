#include "Zembra/ZBPlugInCore.h"
#include "Zembra/ZBUtilities.h"
#include "tests/support/RegistryFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using support::logged;
using support::processLog;
using zembra::dictionaryChanging;
using zembra::ZBPlugInCore;

const URL extensionURL = URL::file("/Applications/App.app/PlugIns/Share.appex");
const URL otherURL = URL::file("/System/Library/PlugIns/Share.APPEX");

std::shared_ptr<ZBPlugInCore> recordAt(const URL& url, const Dictionary& plugInDictionary) {
    return ZBPlugInCore::initWithName("org.example.share", url, Dictionary{{"VKExtension", plugInDictionary}}, Value(),
                                      std::nullopt);
}

TEST(InitWithName, TakesThePlugInDictionaryFromBundleInfoThatHasOne) {
    const Dictionary odd{{"VKExtension", "text"}};
    for (const Value& info : {Value(Array()), Value(Dictionary()), Value(odd)}) {
        EXPECT_FALSE(ZBPlugInCore::initWithName("org.example.share", extensionURL, info, Dictionary(), std::nullopt));
        EXPECT_TRUE(logged(LogLevel::standard, "malformed plug-in dictionary in plug-in org.example.share at " +
                                                   extensionURL.absoluteString() + ": " + info.description()));
    }
    EXPECT_FALSE(ZBPlugInCore::initWithName(Value(), extensionURL, Value(), Value(), std::nullopt));
    EXPECT_TRUE(logged(LogLevel::error, "missing identifier in plug-in at " + extensionURL.path()));
    // The plug-in dictionary that is given along counts only where bundle info leaves none.
    const Dictionary extension{{"Multiple", false}};
    for (const Value& info : {Value(), Value(Dictionary{{"VKExtension", extension}})}) {
        const auto made = ZBPlugInCore::initWithName("a", extensionURL, info, odd, std::nullopt);
        EXPECT_TRUE(made->plugInDictionary()->sharesStorageWith(info ? extension : odd));
    }
    EXPECT_TRUE(logged(LogLevel::standard, "multiplexed plug-ins (Multiple key) obsolete and ignored"));
}

TEST(PlugInCoreDeathTest, EqualityIsByUuidAndWhatCannotBeStopsTheProcess) {
    const auto first = recordAt(extensionURL, {});
    const auto same = ZBPlugInCore::initWithName("org.example.b", otherURL, Value(), Value(), first->uuid());
    EXPECT_TRUE(*first == *same && first->hash() == same->hash() && !(*first == *recordAt(extensionURL, {})));
    processLog.print();
    EXPECT_DEATH((void)ZBPlugInCore().isEqual(*first), "self.uuid");
    EXPECT_DEATH((void)same->oldStyle(), "unknown plug-in configuration style");
}

TEST(Diagnose, AnswersTheFirstFault) {
    // Each step changes what was wrong before.
    const std::tuple<const char*, Value, URL, const char*> steps[] = {
        {"PassProxy", false, otherURL, "missing \"VKExtensionProtocol\" key in Info.vlist or SDK"},
        {"EmbeddedCode", false, extensionURL, "missing \"VKExtensionAttributes\" key in Info.vlist or SDK"},
        {"VKExtensionAttributes", Dictionary(), extensionURL,
         "Application Extensions may not use the \"PrincipalClass\" key"},
        {"VKExtensionProtocol", "P", otherURL, "the \"PassProxy\" key is not supported on this platform"},
        {"PassProxy", Value(), otherURL, "hybrid plug-ins are not supported on this platform"},
        {"EmbeddedCode", Value(), otherURL, "No error 0"},
        {"PrincipalClass", Value(), extensionURL, "No error 0"}};
    Dictionary plugIn{{"PrincipalClass", "C"}};
    for (const auto& [key, value, url, text] : steps) {
        plugIn = *dictionaryChanging(plugIn, key, value);
        EXPECT_EQ(recordAt(url, plugIn)->diagnose().value_or(Error{"No", 0}).text(), text);
    }
    const char* unnamed = "missing identifier (no VKExtensionIdentifier, nor even VBBundleIdentifier)";
    EXPECT_EQ(ZBPlugInCore().diagnose(), (Error{"Zembra", 12, unnamed}));
}

TEST(ResolveSDK, MergesAndFillsInAttributesAndVersion) {
    const Dictionary own{{"VKExtensionPointIdentifier", "org.example.point"},
                         {"CleanTimeout", 1},
                         {"Shared", Array{"Icons", "Fonts"}},
                         {"Nested", Dictionary{{"Shared", "."}, {"Mixed", "own"}}}};
    const Dictionary sdk{{"CleanTimeout", 9},
                         {"Shared", Array{"Fonts", "Sounds"}},
                         {"Nested", Dictionary{{"Shared", Array{"Fonts"}}, {"Mixed", Dictionary()}, {"New", 1}}}};
    const std::string before = Value(Array{own, sdk}).description();
    support::FakeRegistry registry;
    const auto plugIn = recordAt(otherURL, own);
    plugIn->resolveSDK(registry);
    EXPECT_TRUE(logged(LogLevel::standard, "plug-in sdk \"org.example.point\" not registered"));
    registry.setSDKDictionary("org.example.point", {{"VKExtension", sdk}});
    plugIn->resolveSDK(registry);
    EXPECT_EQ(Value(*plugIn->plugInDictionary()).description(),
              "{VKExtensionPointIdentifier = org.example.point; CleanTimeout = 9; Shared = (Icons, Fonts, Sounds); "
              "Nested = {Shared = .; Mixed = own; New = 1}; VKExtensionAttributes = {VKExtensionVersion = 1}}");
    EXPECT_EQ(Value(Array{own, sdk}).description(), before) << "the manifests themselves are not touched";
}

// Forms.

const Dictionary plugInInfo{{"VKExtensionAttributes", Dictionary{{"VKExtensionVersion", "1.2"}}}};
const Dictionary bundleInfo{{"VBBundleIdentifier", "org.example.share"},
                            {"VBBundleDisplayName", "Share"},
                            {"VBBundleInfoVlistURL", "file:///Applications/App.app/PlugIns/Share.appex/Info.vlist"},
                            {"VKExtension", plugInInfo}};

/// A form with all that a form may have.
const Dictionary whole{{"hubProtocolVersion", UINT64_MAX},
                       {"path", "/Applications/App.app/PlugIns/Share.appex"},
                       {"systemResident", true},
                       {"identifier", "org.example.share"},
                       {"original-identifier", "org.example.share.first"},
                       {"version", "1.2"},
                       {"bundleInfo", bundleInfo},
                       {"info", plugInInfo},
                       {"uuid", "0A1B2C3D-4E5F-4A6B-8C7D-9E0F1A2B3C4D"},
                       {"lastmodified", -7},
                       {"annotations", Dictionary{{"election", 1}}},
                       {"entitlements", Dictionary{{"an.entitlement", true}}},
                       {"containingPath", "/Applications/App.app"},
                       {"localizedContainingDisplayName", "Anwendung"},
                       {"localizedDisplayName", "Teilen"},
                       {"localizedShortName", "T."},
                       {"localizedFilevaneActionNames", Dictionary()}};

/// What a form makes in which `value` stands under `key`, or nothing when it is absent.
std::shared_ptr<ZBPlugInCore> restored(std::string_view key, const Value& value) {
    return ZBPlugInCore::initWithForm(*dictionaryChanging(whole, key, value));
}

TEST(ExportForm, HoldsWhatTheRecordHas) {
    const auto plugIn = ZBPlugInCore::initWithForm(whole);
    Failure error;
    const Dictionary form = plugIn->exportForm(&error);
    auto exportedInfo = *dictionaryChanging(bundleInfo, "VBBundleInfoVlistURL", Value());
    exportedInfo.set("VBBundleDisplayName", "Teilen");
    const auto expected = *dictionaryChanging(whole, "bundleInfo", exportedInfo);
    EXPECT_EQ(Value(form).description(), Value(expected).description()) << "the order too";
    EXPECT_EQ(error, std::nullopt);
    EXPECT_TRUE(form.dictionary("info")->sharesStorageWith(*plugIn->plugInDictionary()));
    EXPECT_EQ(plugIn->bundleInfoDictionary(), bundleInfo) << "the record's own keeps the manifest's name and all keys";

    const auto least = ZBPlugInCore::initWithForm(
        {{"path", "/A.appex"}, {"identifier", "a"}, {"bundleInfo", Dictionary{{"VKExtension", Dictionary()}}}});
    EXPECT_EQ(Value(*dictionaryChanging(least->exportForm(&error), "uuid", Value())).description(),
              "{hubProtocolVersion = 1; path = /A.appex; systemResident = false; identifier = a; version = <none>; "
              "bundleInfo = {VKExtension = {}}; info = {}; lastmodified = 0; annotations = {}}");
    EXPECT_EQ(error, (Error{"Zembra", 12, "the plug-in has no \"original-identifier\""}));
}

TEST(InitWithForm, ReadsWhatIsThere) {
    EXPECT_EQ(restored("hubProtocolVersion", 0)->hubProtocolVersion(), 0U);
    EXPECT_EQ(restored("hash", Value::data("h"))->cdhash(), Value::data("h"));
    EXPECT_EQ(restored("requirement", "identifier x")->requirement(), Value("identifier x"));
    for (const Value& unusable : {Value(), Value("no uuid"), Value(5)})
        EXPECT_NE(*restored("uuid", unusable), *restored("uuid", unusable)) << "each has one of its own";
    // Optional values of another kind are neither checked nor lost.
    for (const char* key : {"entitlements", "localizedShortName", "localizedFilevaneActionNames"})
        EXPECT_EQ(restored(key, 5)->exportForm(nullptr)[key], Value(5)) << key;
    const auto bare = restored("bundleInfo", Value())->exportForm(nullptr);
    EXPECT_FALSE(bare.contains("bundleInfo") || bare.contains("info"));
    for (const char* key : {"path", "identifier", "bundleInfo"}) EXPECT_FALSE(restored(key, 5)) << key;
    EXPECT_FALSE(restored("path", Value()) || restored("identifier", Value()) || restored("bundleInfo", Dictionary()));
}

} // namespace
