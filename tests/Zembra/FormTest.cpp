#include "Zembra/ZBPlugInCore.h"
#include "Zembra/ZBProtocol.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

namespace {

using platform::Array;
using platform::Dictionary;
using platform::Failure;
using platform::MutableDictionary;
using platform::URL;
using platform::UUID;
using platform::Value;
using zembra::ZBPlugInCore;
namespace formKey = zembra::formKey;

const UUID uuid = *UUID::parse("0A1B2C3D-4E5F-4A6B-8C7D-9E0F1A2B3C4D");

Dictionary bundleInfo() {
    return {{"VBBundleIdentifier", "org.example.app.share"},
            {"VBBundleDisplayName", "Share"},
            {"VBBundleInfoVlistURL", "file:///Applications/App.app/PlugIns/Share.appex/Info.vlist"},
            {"VKExtension",
             Dictionary{{"VKExtensionAttributes", Dictionary{{"VKExtensionVersion", "1.2"}}}, {"Shared", "."}}}};
}

/// A record with everything that a form must have, and nothing more.
std::shared_ptr<ZBPlugInCore> record() {
    auto plugIn = ZBPlugInCore::initWithName(
        "org.example.app.share", URL::file("/Applications/App.app/PlugIns/Share.appex/"), bundleInfo(), Value(), uuid);
    plugIn->setOriginalIdentifier("org.example.app.share.first");
    plugIn->setHubProtocolVersion(2);
    plugIn->setLastModified(-7);
    return plugIn;
}

TEST(ExportForm, HoldsTheRequiredValuesAndNoOthers) {
    auto plugIn = record();
    Failure error;
    const MutableDictionary form = plugIn->exportForm(&error);
    EXPECT_EQ(error, std::nullopt);

    MutableDictionary shownInfo = MutableDictionary::copyOf(bundleInfo());
    shownInfo.remove("VBBundleInfoVlistURL");
    const Dictionary expected{{"hubProtocolVersion", 2},
                              {"path", "/Applications/App.app/PlugIns/Share.appex"},
                              {"systemResident", false},
                              {"identifier", "org.example.app.share"},
                              {"original-identifier", "org.example.app.share.first"},
                              {"version", "1.2"},
                              {"bundleInfo", shownInfo},
                              {"info", *bundleInfo().dictionary("VKExtension")},
                              {"uuid", "0A1B2C3D-4E5F-4A6B-8C7D-9E0F1A2B3C4D"},
                              {"lastmodified", -7},
                              {"annotations", Dictionary()}};
    EXPECT_EQ(form, expected) << Value(form).description();
    EXPECT_EQ(form["systemResident"].kind(), platform::Kind::boolean);
    EXPECT_TRUE(form.dictionary("info")->sharesStorageWith(*plugIn->plugInDictionary()));

    plugIn->setPlugInDictionary(Dictionary());
    EXPECT_EQ(plugIn->exportForm(nullptr).string("version"), "<none>");
}

TEST(ExportForm, AddsWhatTheRecordHas) {
    const auto plugIn = record();
    plugIn->setOnSystemVolume(true);
    plugIn->setAnnotations(Dictionary{{"election", 1}});
    plugIn->setEntitlements(Dictionary{{"an.entitlement", true}});
    plugIn->setContainingUrl(URL::file("/Applications/App.app"));
    plugIn->setLocalizedContainingName("Anwendung");
    plugIn->setLocalizedName("Teilen");
    plugIn->setLocalizedShortName("T.");
    plugIn->setLocalizedFilevaneActionNames(Dictionary());
    support::processLog.clear();
    const Dictionary form = plugIn->exportForm(nullptr);
    EXPECT_EQ(support::processLog.messages("cx"),
              (std::vector<std::string>{"export BundleInfo[BundleDisplayName] was Share",
                                        "export BundleInfo[BundleDisplayName] is Teilen"}));

    const Dictionary expected{{"systemResident", true},
                              {"annotations", Dictionary{{"election", 1}}},
                              {"entitlements", Dictionary{{"an.entitlement", true}}},
                              {"containingPath", "/Applications/App.app"},
                              {"localizedContainingDisplayName", "Anwendung"},
                              {"localizedDisplayName", "Teilen"},
                              {"localizedShortName", "T."},
                              {"localizedFilevaneActionNames", Dictionary()}};
    for (const auto& entry : expected) EXPECT_EQ(form[entry.name()], entry.value) << entry.name();
    EXPECT_EQ(form.size(), 17U);
    EXPECT_EQ(form.dictionary("bundleInfo")->string("VBBundleDisplayName"), "Teilen");
    EXPECT_EQ(plugIn->bundleInfoDictionary(), bundleInfo()); // the record's own keeps the manifest's name and all keys
}

/// A record whose plug-in has vanished: its look-ups find no bundle info any more.
struct VanishedPlugIn final : ZBPlugInCore {
    std::optional<Dictionary> bundleInfoDictionary() const override { return std::nullopt; }
};

TEST(ExportForm, LeavesOutWhatIsMissingAndReportsTheFirst) {
    VanishedPlugIn plugIn;
    ASSERT_TRUE(plugIn.setupWithName("org.example.gone", URL::file("/System/Gone.appex"), Value(), Value(), uuid));
    plugIn.setLocalizedName("Weg");
    Failure error;
    const Dictionary form = plugIn.exportForm(&error);
    ASSERT_TRUE(error);
    EXPECT_NE(error->description->find("original-identifier"), std::string::npos) << *error->description;
    for (const auto key : {formKey::originalIdentifier, formKey::bundleInfo, formKey::info}) {
        EXPECT_FALSE(form.contains(key)) << key;
    }
    EXPECT_EQ(form.string("uuid"), uuid.text());
    EXPECT_EQ(form.string("localizedDisplayName"), "Weg");
}

TEST(InitWithForm, RestoresWhatExportWrote) {
    const auto original = record();
    original->setContainingUrl(URL::file("/Applications/App.app"));
    original->setLocalizedName("Teilen");
    original->setOnSystemVolume(true);
    original->setCdhash(Value::data("twenty bytes of hash"));
    original->setHubProtocolVersion(~std::uint64_t{0});
    const auto form = original->exportForm(nullptr);

    const auto restored = ZBPlugInCore::initWithForm(form);
    ASSERT_TRUE(restored);
    EXPECT_EQ(*restored, *original);
    EXPECT_EQ(restored->attributes(), original->attributes());
    EXPECT_EQ(restored->hubProtocolVersion(), ~std::uint64_t{0});
    EXPECT_FALSE(restored->cdhash());
    EXPECT_EQ(restored->exportForm(nullptr), form);
}

TEST(InitWithForm, ReadsWhatIsThere) {
    const auto with = [](std::string_view key, const Value& value) {
        MutableDictionary form = record()->exportForm(nullptr);
        value ? form.set(key, value) : form.remove(key);
        return ZBPlugInCore::initWithForm(form);
    };
    EXPECT_EQ(with("hubProtocolVersion", Value())->hubProtocolVersion(), 1U);
    EXPECT_EQ(with("hubProtocolVersion", 0)->hubProtocolVersion(), 0U);
    EXPECT_EQ(with("lastmodified", Value())->lastModified(), 0);
    EXPECT_FALSE(with("containingPath", Value())->containingUrl());
    EXPECT_EQ(with("hash", Value::data("h"))->cdhash().data(), "h");
    EXPECT_EQ(with("requirement", "identifier x")->requirement().string(), "identifier x");
    EXPECT_FALSE(with("annotations", Value())->annotations());
    EXPECT_EQ(with("uuid", "0a1b2c3d-4e5f-4a6b-8c7d-9e0f1a2b3c4d")->uuidText().string(), uuid.text());
    for (const Value& unusable : {Value(), Value("no uuid"), Value(5)}) {
        const auto first = with("uuid", unusable);
        const auto second = with("uuid", unusable);
        EXPECT_NE(*first, *second);
    }
    // Optional values of another kind are neither checked nor lost.
    EXPECT_EQ(with("entitlements", "odd")->exportForm(nullptr)["entitlements"], Value("odd"));
    EXPECT_EQ(with("localizedShortName", 5)->exportForm(nullptr)["localizedShortName"], Value(5));
}

TEST(InitWithForm, RefusesAFormThatMakesNoRecord) {
    const std::vector<std::pair<std::string_view, Value>> unusable = {
        {"path", {}},
        {"path", 5},
        {"identifier", {}},
        {"identifier", 5},
        {"bundleInfo", "x"},
        {"bundleInfo", Dictionary()},
        {"bundleInfo", Dictionary{{"VKExtension", Array()}}}};
    for (const auto& [key, value] : unusable) {
        MutableDictionary form = record()->exportForm(nullptr);
        value ? form.set(key, value) : form.remove(key);
        EXPECT_EQ(ZBPlugInCore::initWithForm(form), nullptr) << key << " = " << value.description();
    }
    MutableDictionary withoutInfo = record()->exportForm(nullptr);
    withoutInfo.remove("bundleInfo");
    const auto plugIn = ZBPlugInCore::initWithForm(withoutInfo);
    ASSERT_TRUE(plugIn);
    EXPECT_FALSE(plugIn->bundleInfoDictionary());
    EXPECT_FALSE(plugIn->plugInDictionary());
}

struct LocalizedInfo {
    int calls = 0;
    std::optional<Dictionary> values;
    Failure error;

    LocalizedInfo(const ZBPlugInCore& plugIn, const Array& keys) {
        plugIn.localizedInfoDictionaryForKeys(keys, [this](const auto& foundValues, const Failure& foundError) {
            ++calls;
            values = foundValues;
            error = foundError;
        });
    }
};

TEST(LocalizedInfo, PrefersTheLocalizedNames) {
    const auto plugIn = record();
    const Array keys{"VBBundleDisplayName", "VBBundleName", "VBBundleIdentifier", "Unknown"};
    const LocalizedInfo plain(*plugIn, keys);
    EXPECT_EQ(plain.values,
              (Dictionary{{"VBBundleDisplayName", "Share"}, {"VBBundleIdentifier", "org.example.app.share"}}));
    EXPECT_EQ(plain.calls, 1);
    plugIn->setLocalizedName("Teilen");
    plugIn->setLocalizedShortName("T.");
    const LocalizedInfo localized(*plugIn, keys);
    EXPECT_EQ(localized.values, (Dictionary{{"VBBundleDisplayName", "Teilen"},
                                            {"VBBundleName", "T."},
                                            {"VBBundleIdentifier", "org.example.app.share"}}));
    EXPECT_EQ(localized.error, std::nullopt);
}

TEST(LocalizedInfo, FailsWithoutBundleInfoOfItsOwnOrForAForeignValue) {
    const auto bare = ZBPlugInCore::initWithName("org.example.bare", URL::file("/Bare"), Value(), Dictionary(), uuid);
    const LocalizedInfo unresolved(*bare, {"VBBundleName"});
    EXPECT_EQ(unresolved.values, std::nullopt);
    EXPECT_EQ(unresolved.error, (platform::Error{"Zembra", -1, "Unable to resolve plugin for org.example.bare"}));
    EXPECT_EQ(unresolved.calls, 1);

    const auto foreign = record();
    MutableDictionary info = MutableDictionary::copyOf(bundleInfo());
    info.set("Odd", uuid);
    foreign->setBundleInfoDictionary(info);
    const LocalizedInfo refused(*foreign, {"VBBundleIdentifier", "Odd"});
    EXPECT_EQ(refused.values, std::nullopt);
    EXPECT_EQ(
        refused.error->description,
        "Value of info dictionary key \"Odd\" for plugin org.example.app.share does not conform to secure coding!");
    EXPECT_EQ(refused.calls, 1);
}

} // namespace
