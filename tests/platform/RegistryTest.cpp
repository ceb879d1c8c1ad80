#include "platform/linux/Registry.h"
#include "platform/linux/Containers.h"
#include "tests/support/BundleTree.h"
#include "tests/support/LocaleFake.h"
#include "tests/support/RegistryFake.h"
#include "tests/support/ScratchDirectory.h"

#include <algorithm>
#include <gtest/gtest.h>

// What every registry does, on the one in memory and on the one on disk.

namespace {

using namespace platform;

/// A registry with two plug-ins in one application and one on the system volume.
class World {
public:
    virtual ~World() = default;
    virtual Registry& registry() = 0;
    virtual std::string application() const = 0;
    virtual std::string systemPlugIn() const = 0;
    virtual void installOneMore() = 0;
    virtual void allowRegistration() = 0;
    std::string plugIn(const std::string& name) const { return application() + "/PlugIns/" + name + ".appex"; }
};

const std::string greeting = "greeting";

class MemoryWorld final : public World {
public:
    MemoryWorld() {
        auto record = std::make_shared<const ApplicationRecord>(ApplicationRecord{
            .bundleURL = URL::file(application()), .bundleIdentifier = "app", .localizedName = std::nullopt});
        for (const char* name : {"b", "a"})
            _registry.install({.path = plugIn(name), .info = support::plugInInfo(name), .containingBundle = record});
        _registry.install({.path = systemPlugIn(), .info = support::plugInInfo("system"), .onSystemPartition = true});
        _registry.setStringTable(systemPlugIn(), "Localizable", {{greeting, "Hello"}});
        _registry.setSDKDictionary("point", Dictionary{{"key", "value"}});
    }
    Registry& registry() override { return _registry; }
    std::string application() const override { return "/Applications/One.app"; }
    std::string systemPlugIn() const override { return "/System/Library/PlugIns/system.plugin"; }
    void installOneMore() override { _registry.install({.path = plugIn("c"), .info = support::plugInInfo("c")}); }
    void allowRegistration() override {
        _registry.allowRegistration();
        _registry.onUnregister([this](const URL& url) { _registry.uninstall(*_registry.plugInForURL(url)->uuid); });
    }

private:
    support::FakeRegistry _registry;
};

class DiskWorld final : public World {
public:
    DiskWorld() {
        support::writeApplication(application(), {"b", "a"});
        support::writeManifest(systemPlugIn(), support::plugInInfo("system"));
        support::writeFile(systemPlugIn() + "/Resources/en/Localizable.vlist",
                           *encodeXML(Dictionary{{greeting, "Hello"}}));
        support::writeFile(_scratch / "System/Library/SDKs/point.vlist", *encodeXML(Dictionary{{"key", "value"}}));
        _registry.emplace(linux_::Root(_scratch.path()), _locale, _containers);
    }
    Registry& registry() override { return *_registry; }
    std::string application() const override { return _scratch / "Applications/One.app"; }
    std::string systemPlugIn() const override { return _scratch / "System/Library/PlugIns/system.plugin"; }
    void installOneMore() override {
        support::writeManifest(plugIn("c"), support::plugInInfo("c"));
        _registry->settle();
    }
    void allowRegistration() override {}

private:
    support::ScratchDirectory _scratch;
    support::FakeLocale _locale;
    linux_::Containers _containers{linux_::Root(_scratch.path())};
    std::optional<linux_::Registry> _registry;
};

class AnyRegistry : public testing::TestWithParam<bool> {
protected:
    std::unique_ptr<World> world =
        GetParam() ? std::unique_ptr<World>(new DiskWorld) : std::unique_ptr<World>(new MemoryWorld);
    Registry& registry = world->registry();
};

INSTANTIATE_TEST_SUITE_P(Registries, AnyRegistry, testing::Bool(),
                         [](const auto& world) { return world.param ? "Disk" : "Memory"; });

std::vector<std::string> identifiers(const std::vector<PlugInProxyRef>& proxies) {
    std::vector<std::string> names;
    for (const auto& proxy : proxies) names.push_back(proxy->plugInIdentifier.value_or("none"));
    return names;
}

TEST_P(AnyRegistry, InstalledPlugInsAreOrderedAndFoundByUUID) {
    const auto installed = registry.installedPlugIns();
    ASSERT_TRUE(installed);
    ASSERT_EQ(installed->size(), 3U);
    EXPECT_TRUE(std::ranges::is_sorted(*installed, {}, [](const auto& proxy) { return proxy->uuid; }));
    for (const auto& proxy : *installed) {
        ASSERT_NE(registry.plugInForUUID(*proxy->uuid), nullptr);
        EXPECT_EQ(registry.plugInForUUID(*proxy->uuid)->plugInIdentifier, proxy->plugInIdentifier);
    }
    EXPECT_EQ(registry.plugInForUUID(UUID::random()), nullptr);

    const auto kept =
        registry.plugInsMatching({}, [](const auto& identifier, const auto&) { return identifier != "a"; });
    ASSERT_TRUE(kept);
    auto names = identifiers(*kept);
    std::ranges::sort(names);
    EXPECT_EQ(names, (std::vector<std::string>{"b", "system"})) << "what the filter keeps";
}

TEST_P(AnyRegistry, PlugInForURLTakesFileURLsOfPlugInsOnly) {
    const std::string path = world->plugIn("a");
    for (const auto& url : {URL::file(path), URL::file(path + "/")}) {
        ASSERT_NE(registry.plugInForURL(url), nullptr) << url.absoluteString();
        EXPECT_EQ(registry.plugInForURL(url)->plugInIdentifier, "a");
    }
    for (const auto& url : {URL::file(path + "x"), URL::file(world->application()), *URL::parse("https://host" + path)})
        EXPECT_EQ(registry.plugInForURL(url), nullptr) << url.absoluteString();
}

TEST_P(AnyRegistry, ApplicationGivesItsPlugInsInTheOrderOfTheirPaths) {
    const auto application = registry.applicationForURL(URL::file(world->application()));
    ASSERT_NE(application, nullptr);
    EXPECT_TRUE(application->isApplication);
    EXPECT_EQ(identifiers(registry.plugInsOfApplication(*application)), (std::vector<std::string>{"a", "b"}));
    const auto inside = registry.plugInForURL(URL::file(world->plugIn("a")));
    EXPECT_EQ(inside->containingBundle->bundleURL, application->bundleURL);
    EXPECT_FALSE(inside->onSystemPartition);
    EXPECT_EQ(registry.applicationForURL(URL::file(world->application() + "x")), nullptr);
    EXPECT_TRUE(registry.plugInsOfApplication(ApplicationRecord{URL::file("/none.app"), {}, {}}).empty());

    const auto outside = registry.plugInForURL(URL::file(world->systemPlugIn()));
    ASSERT_NE(outside, nullptr);
    EXPECT_TRUE(outside->onSystemPartition);
    EXPECT_EQ(outside->containingBundle, nullptr);
}

TEST_P(AnyRegistry, KnowledgeChangesWithTheDataAndOnlyThen) {
    const auto before = registry.knowledgeUUID();
    const auto sequence = registry.knowledgeSequenceNumber();
    (void)registry.installedPlugIns();
    registry.clearSchemaCaches();
    EXPECT_EQ(registry.knowledgeUUID(), before);
    world->installOneMore();
    EXPECT_NE(registry.knowledgeUUID(), before);
    EXPECT_GT(registry.knowledgeSequenceNumber(), sequence);
    EXPECT_NE(registry.plugInForURL(URL::file(world->plugIn("c"))), nullptr);
}

TEST_P(AnyRegistry, RegistrationIsRefusedAndUnregisteredIsGone) {
    EXPECT_FALSE(registry.registerPlugIn(URL::file("/nowhere.appex")));
    EXPECT_FALSE(registry.unregisterPlugIn(URL::file("/nowhere.appex")));
    world->allowRegistration();
    const auto uuid = *registry.plugInForURL(URL::file(world->plugIn("a")))->uuid;
    EXPECT_TRUE(registry.unregisterPlugIn(URL::file(world->plugIn("a"))));
    EXPECT_EQ(registry.plugInForURL(URL::file(world->plugIn("a"))), nullptr);
    EXPECT_EQ(registry.plugInForUUID(uuid), nullptr);
}

TEST_P(AnyRegistry, StringsAndSDKsAreFoundByName) {
    const auto proxy = registry.plugInForURL(URL::file(world->systemPlugIn()));
    using Strings = std::map<std::string, std::string>;
    EXPECT_EQ(registry.localizedStrings(*proxy, {greeting, "none"}, "Localizable"), (Strings{{greeting, "Hello"}}));
    EXPECT_EQ(registry.localizedStrings(*proxy, {greeting}, "Other"), Strings());
    ASSERT_TRUE(registry.sdkDictionary("point"));
    EXPECT_EQ(registry.sdkDictionary("point")->string("key"), "value");
    EXPECT_FALSE(registry.sdkDictionary("other"));
}

} // namespace
