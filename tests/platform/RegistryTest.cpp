#include "platform/linux/Registry.h"
#include "platform/linux/Containers.h"
#include "tests/support/BundleTree.h"
#include "tests/support/LocaleFake.h"
#include "tests/support/RegistryFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

namespace {

using namespace platform;
using namespace support;
using Strings = std::map<std::string, std::string>;

/// The identifiers, each before a space.
std::string identifiers(const std::vector<PlugInProxyRef>& proxies) {
    std::string names;
    for (const auto& proxy : proxies) names += (proxy ? *proxy->plugInIdentifier : "none") + " ";
    return names;
}

/// What every registry does. There are two plug-ins in one application and one on the system volume, all below `root`,
/// and registration is allowed.
void expectConformance(Registry& registry, const std::string& root) {
    const auto app = URL::file(root + "/Applications/One.app");
    const std::string path = app.path() + "/PlugIns/a";
    const auto installed = *registry.installedPlugIns();
    EXPECT_EQ(installed.size(), 3U);
    EXPECT_EQ(registry.installedPlugIns(), registry.installedPlugIns()) << "one list for all who ask";
    EXPECT_TRUE(std::ranges::is_sorted(installed, {}, [](const auto& proxy) { return proxy->uuid; }));
    for (const auto& proxy : installed)
        EXPECT_EQ(identifiers({registry.plugInForUUID(*proxy->uuid)}), identifiers({proxy}));
    EXPECT_EQ(registry.plugInForUUID(UUID::random()), nullptr);
    const auto isA = [](const auto& identifier, const auto&) { return identifier == "a"; };
    EXPECT_EQ(identifiers(*registry.plugInsMatching({}, isA)), "a ");
    EXPECT_EQ(identifiers({registry.plugInForURL(URL::file(path + "/"))}), "a ");
    for (const auto& url : {URL::file(path + "x"), app, *URL::parse("https://host" + path)})
        EXPECT_EQ(registry.plugInForURL(url), nullptr) << url.absoluteString();

    const auto application = registry.applicationForURL(app);
    ASSERT_NE(application, nullptr);
    EXPECT_EQ(identifiers(registry.plugInsOfApplication(*application)), "a b ") << "by their paths";
    EXPECT_EQ(registry.applicationForURL(URL::file(app.path() + "x")), nullptr);
    EXPECT_EQ(identifiers(registry.plugInsOfApplication(ApplicationRecord{URL::file("/none.app"), {}, {}})), "");
    const auto inside = registry.plugInForURL(URL::file(path));
    EXPECT_EQ(inside->containingBundle->bundleURL, application->bundleURL);
    EXPECT_FALSE(inside->onSystemPartition);
    const auto outside = registry.plugInForURL(URL::file(root + "/System/Library/PlugIns/system.plugin"));
    EXPECT_TRUE(outside->onSystemPartition);
    EXPECT_EQ(outside->containingBundle, nullptr);
    EXPECT_EQ(registry.localizedStrings(*outside, {"hi", "none"}, "Localizable"), (Strings{{"hi", "Hello"}}));
    EXPECT_EQ(registry.sdkDictionary("point"), (Dictionary{{"key", "value"}}));
    EXPECT_FALSE(registry.sdkDictionary("other"));

    const auto knowledge = registry.knowledgeUUID();
    const auto sequence = registry.knowledgeSequenceNumber();
    EXPECT_TRUE(registry.unregisterPlugIn(URL::file(path)));
    EXPECT_FALSE(registry.plugInForURL(URL::file(path)) || registry.plugInForUUID(*inside->uuid));
    EXPECT_NE(registry.knowledgeUUID(), knowledge);
    EXPECT_GT(registry.knowledgeSequenceNumber(), sequence);
}

TEST(AnyRegistry, InMemory) {
    FakeRegistry registry;
    EXPECT_FALSE(registry.registerPlugIn(URL::file("/a")) || registry.unregisterPlugIn(URL::file("/a")));
    const auto app = registry.installApplication({URL::file("/Applications/One.app"), {}, {}});
    for (const std::string name : {"b", "a"})
        registry.install(
            {.path = app->bundleURL.path() + "/PlugIns/" + name, .info = plugInInfo(name), .containingBundle = app});
    const std::string system = "/System/Library/PlugIns/system.plugin";
    registry.install({.path = system, .info = plugInInfo("system"), .onSystemPartition = true});
    registry.setStringTable(system, "Localizable", {{"hi", "Hello"}});
    registry.setSDKDictionary("point", {{"key", "value"}});
    registry.allowRegistration();
    registry.onUnregister([&](const URL& url) { registry.uninstall(*registry.plugInForURL(url)->uuid); });
    expectConformance(registry, "");
}

TEST(AnyRegistry, OnDisk) {
    const ScratchDirectory root;
    const std::string app = root / "Applications/One.app";
    const std::string system = root / "System/Library/PlugIns/system.plugin";
    writeApplication(app);
    for (const std::string name : {"b", "a"}) writeManifest(app + "/PlugIns/" + name, plugInInfo(name));
    writeManifest(system, plugInInfo("system"));
    writeFile(system + "/Resources/en/Localizable.vlist", *encodeXML(Dictionary{{"hi", "Hello"}}));
    writeFile(root / "System/Library/SDKs/point.vlist", *encodeXML(Dictionary{{"key", "value"}}));
    FakeLocale locale;
    linux_::Containers containers{linux_::Root(root.path())};
    linux_::Registry registry{linux_::Root(root.path()), locale, containers};
    registry.settle();
    expectConformance(registry, root.path());
}

} // namespace
