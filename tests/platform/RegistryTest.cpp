#include "platform/linux/Registry.h"
#include "platform/linux/Containers.h"
#include "tests/support/BundleTree.h"
#include "tests/support/LocaleFake.h"
#include "tests/support/RegistryFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

// What every registry does, on the one in memory and on the one on disk.

namespace {

using namespace platform;
using Identifiers = std::vector<std::string>;
using Strings = std::map<std::string, std::string>;
using support::plugInInfo;

const Strings greeting{{"greeting", "Hello"}};
const Dictionary pointDictionary{{"key", "value"}};

// Each has two plug-ins in one application and one on the system volume.

struct MemoryWorld {
    MemoryWorld() {
        const auto record =
            std::make_shared<const ApplicationRecord>(ApplicationRecord{URL::file(application), {}, {}});
        for (const char* name : {"b", "a"})
            registry.install({.path = plugIns + name, .info = plugInInfo(name), .containingBundle = record});
        registry.install({.path = systemPlugIn, .info = plugInInfo("system"), .onSystemPartition = true});
        registry.setStringTable(systemPlugIn, "Localizable", greeting);
        registry.setSDKDictionary("point", pointDictionary);
    }
    void allowRegistration() {
        registry.allowRegistration();
        registry.onUnregister([this](const URL& url) { registry.uninstall(*registry.plugInForURL(url)->uuid); });
    }

    const std::string application = "/Applications/One.app";
    const std::string plugIns = application + "/PlugIns/";
    const std::string systemPlugIn = "/System/Library/PlugIns/system.plugin";
    support::FakeRegistry registry;
};

struct DiskWorld {
    DiskWorld() {
        support::writeApplication(application);
        for (const char* name : {"b", "a"}) support::writeManifest(plugIns + name, plugInInfo(name));
        support::writeManifest(systemPlugIn, plugInInfo("system"));
        support::writeFile(systemPlugIn + "/Resources/en/Localizable.vlist",
                           *encodeXML(Dictionary{{"greeting", "Hello"}}));
        support::writeFile(scratch / "System/Library/SDKs/point.vlist", *encodeXML(pointDictionary));
        registry.settle();
    }
    void allowRegistration() {}

    support::ScratchDirectory scratch;
    const std::string application = scratch / "Applications/One.app";
    const std::string plugIns = application + "/PlugIns/";
    const std::string systemPlugIn = scratch / "System/Library/PlugIns/system.plugin";
    support::FakeLocale locale;
    linux_::Containers containers{linux_::Root(scratch.path())};
    linux_::Registry registry{linux_::Root(scratch.path()), locale, containers};
};

template <class World> class AnyRegistry : public testing::Test {
protected:
    World world;
    const URL a = URL::file(world.plugIns + "a");
};
using Worlds = testing::Types<MemoryWorld, DiskWorld>;
TYPED_TEST_SUITE(AnyRegistry, Worlds);

Identifiers identifiers(const std::vector<PlugInProxyRef>& proxies) {
    Identifiers names;
    for (const auto& proxy : proxies) names.push_back(proxy ? *proxy->plugInIdentifier : "none");
    return names;
}

TYPED_TEST(AnyRegistry, LookUpsFindWhatIsInstalled) {
    const auto& here = this->world;
    Registry& registry = this->world.registry;
    const auto installed = *registry.installedPlugIns();
    EXPECT_EQ(installed.size(), 3U);
    EXPECT_TRUE(std::ranges::is_sorted(installed, {}, [](const auto& proxy) { return proxy->uuid; }));
    for (const auto& proxy : installed)
        EXPECT_EQ(identifiers({registry.plugInForUUID(*proxy->uuid)}), identifiers({proxy}));
    EXPECT_EQ(registry.plugInForUUID(UUID::random()), nullptr);
    const auto isNotA = [](const auto& identifier, const auto&) { return identifier != "a"; };
    const auto kept = identifiers(*registry.plugInsMatching({}, isNotA));
    EXPECT_EQ(std::multiset(kept.begin(), kept.end()), (std::multiset<std::string>{"b", "system"}));

    const std::string path = here.plugIns + "a";
    EXPECT_EQ(identifiers({registry.plugInForURL(this->a), registry.plugInForURL(URL::file(path + "/"))}),
              (Identifiers{"a", "a"}));
    for (const auto& url : {URL::file(path + "x"), URL::file(here.application), *URL::parse("https://host" + path)})
        EXPECT_EQ(registry.plugInForURL(url), nullptr) << url.absoluteString();

    const auto application = registry.applicationForURL(URL::file(here.application));
    ASSERT_NE(application, nullptr);
    EXPECT_TRUE(application->isApplication);
    EXPECT_EQ(identifiers(registry.plugInsOfApplication(*application)), (Identifiers{"a", "b"})) << "by their paths";
    EXPECT_EQ(registry.applicationForURL(URL::file(here.application + "x")), nullptr);
    EXPECT_TRUE(registry.plugInsOfApplication(ApplicationRecord{URL::file("/none.app"), {}, {}}).empty());
    const auto inside = registry.plugInForURL(this->a);
    EXPECT_EQ(inside->containingBundle->bundleURL, application->bundleURL);
    EXPECT_FALSE(inside->onSystemPartition);
    const auto outside = registry.plugInForURL(URL::file(here.systemPlugIn));
    EXPECT_TRUE(outside->onSystemPartition);
    EXPECT_EQ(outside->containingBundle, nullptr);

    EXPECT_EQ(registry.localizedStrings(*outside, {"greeting", "none"}, "Localizable"), greeting);
    EXPECT_EQ(registry.localizedStrings(*outside, {"greeting"}, "Other"), Strings());
    EXPECT_EQ(registry.sdkDictionary("point"), pointDictionary);
    EXPECT_FALSE(registry.sdkDictionary("other"));
}

TYPED_TEST(AnyRegistry, WhatIsUnregisteredIsGoneAndChangesTheKnowledge) {
    Registry& registry = this->world.registry;
    const auto uuid = *registry.plugInForURL(this->a)->uuid;
    const auto knowledge = registry.knowledgeUUID();
    const auto sequence = registry.knowledgeSequenceNumber();
    EXPECT_FALSE(registry.registerPlugIn(URL::file("/nowhere.appex")));
    EXPECT_FALSE(registry.unregisterPlugIn(URL::file("/nowhere.appex")));
    EXPECT_EQ(registry.knowledgeUUID(), knowledge);
    this->world.allowRegistration();
    EXPECT_TRUE(registry.unregisterPlugIn(this->a));
    EXPECT_EQ(registry.plugInForURL(this->a), nullptr);
    EXPECT_EQ(registry.plugInForUUID(uuid), nullptr);
    EXPECT_NE(registry.knowledgeUUID(), knowledge);
    EXPECT_GT(registry.knowledgeSequenceNumber(), sequence);
}

} // namespace
