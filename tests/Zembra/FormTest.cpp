#include "Zembra/ZBPlugInCore.h"
#include "Zembra/ZBUtilities.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using zembra::ZBPlugInCore;

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

/// What a form makes in which `value` stands under `key`, or nothing when it is absent.
std::shared_ptr<ZBPlugInCore> restored(std::string_view key, const Value& value) {
    return ZBPlugInCore::initWithForm(*zembra::dictionaryChanging(record()->exportForm(nullptr), key, value));
}

TEST(ExportForm, HoldsTheRequiredValuesAndNoOthers) {
    const auto plugIn = record();
    Failure error;
    const MutableDictionary form = plugIn->exportForm(&error);
    EXPECT_EQ(error, std::nullopt);
    const Dictionary expected{{"hubProtocolVersion", 2},
                              {"path", "/Applications/App.app/PlugIns/Share.appex"},
                              {"systemResident", false},
                              {"identifier", "org.example.app.share"},
                              {"original-identifier", "org.example.app.share.first"},
                              {"version", "1.2"},
                              {"bundleInfo", *zembra::dictionaryChanging(bundleInfo(), "VBBundleInfoVlistURL", {})},
                              {"info", *bundleInfo().dictionary("VKExtension")},
                              {"uuid", "0A1B2C3D-4E5F-4A6B-8C7D-9E0F1A2B3C4D"},
                              {"lastmodified", -7},
                              {"annotations", Dictionary()}};
    EXPECT_EQ(form, expected) << Value(form).description();
    EXPECT_EQ(form["systemResident"].kind(), Kind::boolean);
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
    const Dictionary form = plugIn->exportForm(nullptr);
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
    for (const char* key : {"original-identifier", "bundleInfo", "info"}) EXPECT_FALSE(form.contains(key)) << key;
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
    const auto copy = ZBPlugInCore::initWithForm(form);
    ASSERT_TRUE(copy);
    EXPECT_EQ(*copy, *original);
    EXPECT_EQ(copy->attributes(), original->attributes());
    EXPECT_FALSE(copy->cdhash());
    EXPECT_EQ(copy->exportForm(nullptr), form);
}

TEST(InitWithForm, ReadsWhatIsThere) {
    EXPECT_EQ(restored("hubProtocolVersion", Value())->hubProtocolVersion(), 1U);
    EXPECT_EQ(restored("hubProtocolVersion", 0)->hubProtocolVersion(), 0U);
    EXPECT_EQ(restored("lastmodified", Value())->lastModified(), 0);
    EXPECT_FALSE(restored("containingPath", Value())->containingUrl());
    EXPECT_EQ(restored("hash", Value::data("h"))->cdhash().data(), "h");
    EXPECT_EQ(restored("requirement", "identifier x")->requirement().string(), "identifier x");
    EXPECT_FALSE(restored("annotations", Value())->annotations());
    EXPECT_EQ(restored("uuid", "0a1b2c3d-4e5f-4a6b-8c7d-9e0f1a2b3c4d")->uuidText().string(), uuid.text());
    for (const Value& unusable : {Value(), Value("no uuid"), Value(5)}) {
        EXPECT_NE(*restored("uuid", unusable), *restored("uuid", unusable)) << "each has one of its own";
    }
    // Optional values of another kind are neither checked nor lost.
    for (const char* key : {"entitlements", "localizedShortName", "localizedFilevaneActionNames"}) {
        EXPECT_EQ(restored(key, 5)->exportForm(nullptr)[key], Value(5)) << key;
    }
    const auto bare = restored("bundleInfo", Value());
    ASSERT_TRUE(bare);
    EXPECT_FALSE(bare->bundleInfoDictionary());
    EXPECT_FALSE(bare->plugInDictionary());
}

TEST(InitWithForm, RefusesAFormThatMakesNoRecord) {
    const std::pair<const char*, Value> unusable[] = {{"path", {}},
                                                      {"path", 5},
                                                      {"identifier", {}},
                                                      {"identifier", 5},
                                                      {"bundleInfo", "x"},
                                                      {"bundleInfo", Dictionary()},
                                                      {"bundleInfo", Dictionary{{"VKExtension", Array()}}}};
    for (const auto& [key, value] : unusable) {
        EXPECT_EQ(restored(key, value), nullptr) << key << " = " << value.description();
    }
}

/// The values, or the error's text; exactly one answer comes.
Value localizedInfo(const ZBPlugInCore& plugIn, const Array& keys) {
    std::vector<Value> answers;
    plugIn.localizedInfoDictionaryForKeys(keys, [&](const auto& values, const Failure& error) {
        EXPECT_NE(values.has_value(), error.has_value());
        if (values) return answers.emplace_back(*values), void();
        EXPECT_EQ(*error, (Error{"Zembra", -1, error->description}));
        answers.emplace_back(error->text());
    });
    return answers.size() == 1 ? answers.front() : Value();
}

TEST(LocalizedInfo, PrefersTheLocalizedNamesAndRefusesForeignValues) {
    const auto plugIn = record();
    const Array keys{"VBBundleDisplayName", "VBBundleName", "Unknown"};
    EXPECT_EQ(localizedInfo(*plugIn, keys), Value(Dictionary{{"VBBundleDisplayName", "Share"}}));
    plugIn->setLocalizedName("Teilen");
    plugIn->setLocalizedShortName("T.");
    EXPECT_EQ(localizedInfo(*plugIn, keys),
              Value(Dictionary{{"VBBundleDisplayName", "Teilen"}, {"VBBundleName", "T."}}));

    plugIn->setBundleInfoDictionary(*zembra::dictionaryChanging(bundleInfo(), "Odd", uuid));
    EXPECT_EQ(localizedInfo(*plugIn, {"VBBundleIdentifier", "Odd"}),
              Value("Value of info dictionary key \"Odd\" for plugin org.example.app.share does not conform to secure "
                    "coding!"));
    const auto bare = ZBPlugInCore::initWithName("org.example.bare", URL::file("/Bare"), Value(), Dictionary(), uuid);
    EXPECT_EQ(localizedInfo(*bare, keys), Value("Unable to resolve plugin for org.example.bare"));
}

} // namespace
