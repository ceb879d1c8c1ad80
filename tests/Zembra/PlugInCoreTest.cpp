#include "Zembra/ZBPlugInCore.h"
#include "Zembra/ZBUtilities.h"
#include "tests/support/RegistryFake.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>
#include <unordered_set>

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
    ZBPlugInCore plugIn;
    EXPECT_FALSE(plugIn.setDictionaries(odd) || plugIn.plugInDictionary());
    EXPECT_TRUE(plugIn.bundleInfoDictionary()->sharesStorageWith(odd)) << "kept all the same";
    // The plug-in dictionary that is given along counts only where bundle info leaves none.
    const Dictionary extension{{"Multiple", false}};
    for (const Value& info : {Value(), Value(Dictionary{{"VKExtension", extension}})}) {
        const auto made = ZBPlugInCore::initWithName("a", extensionURL, info, odd, std::nullopt);
        EXPECT_TRUE(made->plugInDictionary()->sharesStorageWith(info ? extension : odd));
        EXPECT_EQ(made->bundleInfoDictionary().has_value(), bool(info));
    }
    EXPECT_TRUE(logged(LogLevel::standard, "multiplexed plug-ins (Multiple key) obsolete and ignored"));
}

TEST(PlugInCoreDeathTest, EqualityIsByUuidAndWhatCannotBeStopsTheProcess) {
    const auto first = recordAt(extensionURL, {});
    const auto same = ZBPlugInCore::initWithName("org.example.b", otherURL, Value(), Value(), first->uuid());
    std::unordered_set<std::shared_ptr<ZBPlugInCore>, zembra::ZBPlugInHash, zembra::ZBPlugInEqual> set{first};
    EXPECT_TRUE(set.contains(same));
    EXPECT_FALSE(set.contains(recordAt(extensionURL, {})));
    const ZBPlugInCore without;
    EXPECT_FALSE(*first == without);
    processLog.print();
    EXPECT_DEATH((void)without.isEqual(*first), "self.uuid");
    EXPECT_DEATH((void)without.hash(), "self.uuid");
    EXPECT_DEATH((void)same->oldStyle(), "unknown plug-in configuration style");
    same->setBundleInfoDictionary(Dictionary{{"Zembra", Dictionary()}});
    EXPECT_TRUE(same->oldStyle());
}

TEST(DerivedProperties, ReadTheManifest) {
    const auto extension = recordAt(extensionURL, {});
    EXPECT_TRUE(extension->isAppExtension() && !extension->oldStyle());
    for (const Value& spec : {extension->protocolSpec(), extension->principalSpec(), extension->embeddedProtocolSpec()})
        EXPECT_EQ(spec, Value("VKObject"));
    const auto other = recordAt(otherURL, {{"Dedicated", "yes"}, {"VKExtensionAttributes", "odd"}});
    EXPECT_FALSE(other->isAppExtension() || other->protocolSpec() || other->principalSpec() || other->isDedicated());
    EXPECT_FALSE(other->attribute("VKExtensionVersion"));
    const auto data =
        recordAt(otherURL, {{"VKExtensionProtocol", "#Data"}, {"EmbeddedProtocol", "P"}, {"Dedicated", 1}});
    EXPECT_TRUE(data->isData() && data->isDedicated() && data->embeddedProtocolSpec() == Value("P"));
}

TEST(Diagnose, AnswersTheFirstFault) {
    MutableDictionary plugIn{{"PrincipalClass", "C"}, {"PassProxy", false}, {"EmbeddedCode", false}};
    const auto fault = [&](const URL& url) {
        return recordAt(url, plugIn)->diagnose().value_or(Error{"No", 0}).text();
    };
    EXPECT_EQ(fault(otherURL), "missing \"VKExtensionProtocol\" key in Info.vlist or SDK");
    EXPECT_EQ(fault(extensionURL), "missing \"VKExtensionAttributes\" key in Info.vlist or SDK");
    plugIn.set("VKExtensionAttributes", Dictionary());
    EXPECT_EQ(fault(extensionURL), "Application Extensions may not use the \"PrincipalClass\" key");
    plugIn.set("VKExtensionProtocol", "P");
    EXPECT_EQ(fault(otherURL), "the \"PassProxy\" key is not supported on this platform");
    plugIn.remove("PassProxy");
    EXPECT_EQ(fault(otherURL), "hybrid plug-ins are not supported on this platform");
    plugIn.remove("EmbeddedCode");
    EXPECT_EQ(fault(otherURL), "No error 0");
    plugIn.remove("PrincipalClass");
    EXPECT_EQ(fault(extensionURL), "No error 0");
    const char* unnamed = "missing identifier (no VKExtensionIdentifier, nor even VBBundleIdentifier)";
    EXPECT_EQ(ZBPlugInCore().diagnose(), (Error{"Zembra", 12, unnamed}));
}

TEST(Annotations, ChangeInANewDictionary) {
    const auto plugIn = recordAt(extensionURL, {});
    plugIn->setAnnotation("election", 1);
    EXPECT_FALSE(plugIn->annotations());
    const Dictionary before{{"election", 0}};
    MutableDictionary extension;
    plugIn->updateFromForm({{"annotations", before}, {"identifier", "other"}});
    plugIn->setAnnotation("extension", extension);
    plugIn->setAnnotation("election", Value());
    extension.set("later", true);
    EXPECT_EQ(plugIn->annotations(), (Dictionary{{"extension", Dictionary()}}));
    EXPECT_TRUE(before == (Dictionary{{"election", 0}}) && plugIn->identifier() == Value("org.example.share"));
    plugIn->updateFromForm({});
    EXPECT_FALSE(plugIn->annotations());
}

TEST(ResolveSDK, MergesAndFillsInAttributesAndVersion) {
    const Dictionary own{{"VKExtensionPointIdentifier", "org.example.point"},
                         {"Dedicated", false},
                         {"CleanTimeout", 1},
                         {"Shared", Array{"Icons", "Fonts"}},
                         {"Nested", Dictionary{{"Shared", "."}, {"Mixed", "own"}}}};
    const Dictionary sdk{{"VKExtensionProtocol", "Sharing"},
                         {"Dedicated", true},
                         {"CleanTimeout", 9},
                         {"Shared", Array{"Fonts", "Sounds"}},
                         {"Nested", Dictionary{{"Shared", Array{"Fonts"}}, {"Mixed", Dictionary()}, {"New", 1}}}};
    const std::string before = Value(Array{own, sdk}).description();
    support::FakeRegistry registry;
    registry.setSDKDictionary("org.example.point", {{"VKExtension", sdk}});
    const auto known = recordAt(otherURL, own);
    known->resolveSDK(registry);
    EXPECT_EQ(Value(*known->plugInDictionary()).description(),
              "{VKExtensionPointIdentifier = org.example.point; Dedicated = false; CleanTimeout = 9; "
              "Shared = (Icons, Fonts, Sounds); Nested = {Shared = .; Mixed = own; New = 1}; "
              "VKExtensionProtocol = Sharing; VKExtensionAttributes = {VKExtensionVersion = 1}}");
    EXPECT_EQ(Value(Array{own, sdk}).description(), before) << "the manifests themselves are not touched";

    const auto unknown = recordAt(otherURL, {{"VKExtensionPointIdentifier", "org.example.unknown"}});
    unknown->resolveSDK(registry);
    EXPECT_TRUE(logged(LogLevel::standard, "plug-in sdk \"org.example.unknown\" not registered"));
    EXPECT_EQ(unknown->version(), Value("1"));
    const auto odd = recordAt(otherURL, {{"VKExtensionPointIdentifier", 5}});
    odd->resolveSDK(registry);
    EXPECT_FALSE(odd->attributes());
    EXPECT_TRUE(logged(LogLevel::error, "invalid SDK key:5"));
    const auto pointless = recordAt(otherURL, {});
    for (const char* version : {"2.5", "3"}) { // the second comes too late
        pointless->setBundleInfoDictionary(Dictionary{{"VBBundleShortVersionString", version}});
        pointless->resolveSDK(registry);
        EXPECT_EQ(pointless->version(), Value("2.5"));
    }
    EXPECT_EQ(registry.calls("sdkDictionary"), 2) << "a plug-in without an extension point needs no look-up";
}

// Forms.

const UUID uuid = *UUID::parse("0A1B2C3D-4E5F-4A6B-8C7D-9E0F1A2B3C4D");
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
                       {"uuid", uuid.text()},
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
    auto exportedInfo = MutableDictionary::copyOf(bundleInfo);
    exportedInfo.remove("VBBundleInfoVlistURL");
    exportedInfo.set("VBBundleDisplayName", "Teilen");
    EXPECT_EQ(form, dictionaryChanging(whole, "bundleInfo", exportedInfo)) << Value(form).description();
    EXPECT_EQ(error, std::nullopt);
    EXPECT_TRUE(form["systemResident"].boolean() &&
                form.dictionary("info")->sharesStorageWith(*plugIn->plugInDictionary()));
    EXPECT_EQ(plugIn->bundleInfoDictionary(), bundleInfo) << "the record's own keeps the manifest's name and all keys";
    EXPECT_EQ(*ZBPlugInCore::initWithForm(form), *plugIn);
    plugIn->setPlugInDictionary(Dictionary());
    EXPECT_EQ(plugIn->exportForm(nullptr)["version"], Value("<none>"));

    const auto least = ZBPlugInCore::initWithForm(
        {{"path", "/A.appex"}, {"identifier", "a"}, {"bundleInfo", Dictionary{{"VKExtension", plugInInfo}}}});
    EXPECT_EQ(
        Value(*dictionaryChanging(least->exportForm(&error), "uuid", Value())).description(),
        "{hubProtocolVersion = 1; path = /A.appex; systemResident = false; identifier = a; version = 1.2; bundleInfo = "
        "{VKExtension = {VKExtensionAttributes = {VKExtensionVersion = 1.2}}}; info = {VKExtensionAttributes = "
        "{VKExtensionVersion = 1.2}}; lastmodified = 0; annotations = {}}");
    EXPECT_EQ(error, (Error{"Zembra", 12, "the plug-in has no \"original-identifier\""}));
    EXPECT_FALSE(least->annotations() || least->containingUrl() || least->cdhash());
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

TEST(LocalizedInfo, PrefersTheLocalizedNamesAndRefusesForeignValues) {
    Value answer;
    const auto localizedInfo = [&](const std::shared_ptr<ZBPlugInCore>& plugIn, const Array& keys) {
        answer = {};
        plugIn->localizedInfoDictionaryForKeys(keys, [&](const auto& values, const Failure& error) {
            EXPECT_FALSE(answer || (error && error->code != -1)) << "one answer comes";
            answer = values ? Value(*values) : Value(error->text());
        });
        return answer;
    };
    const Array keys{"VBBundleDisplayName", "VBBundleName", "Unknown", 5};
    const auto plugIn = ZBPlugInCore::initWithForm(whole);
    EXPECT_EQ(localizedInfo(plugIn, keys),
              Value(Dictionary{{"VBBundleDisplayName", "Teilen"}, {"VBBundleName", "T."}}));
    plugIn->setLocalizedName(Value());
    plugIn->setLocalizedShortName(Value());
    EXPECT_EQ(localizedInfo(plugIn, keys), Value(Dictionary{{"VBBundleDisplayName", "Share"}}));
    plugIn->setBundleInfoDictionary(*dictionaryChanging(bundleInfo, "Odd", uuid));
    EXPECT_EQ(
        localizedInfo(plugIn, {"VBBundleIdentifier", "Odd"}),
        Value("Value of info dictionary key \"Odd\" for plugin org.example.share does not conform to secure coding!"));
    EXPECT_EQ(localizedInfo(restored("bundleInfo", Value()), keys),
              Value("Unable to resolve plugin for org.example.share"));
}

} // namespace
