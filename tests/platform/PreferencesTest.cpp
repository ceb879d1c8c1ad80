#include "platform/linux/Preferences.h"
#include "platform/linux/Files.h"
#include "tests/support/BundleTree.h"
#include "tests/support/PreferencesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

namespace {

using platform::Value;

constexpr const char* domain = "com.example.prefs";

struct LinuxPreferences {
    void store(const std::string& key, const Value& value) {
        EXPECT_FALSE(platform::linux_::Preferences(root, files).setValue(domain, key, value));
    }
    void makeUnreadable() { support::writeFile(file(), "not a property list"); }
    /// The domain's file, once something is stored.
    std::string file() const { return std::filesystem::directory_iterator(directory)->path().string(); }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::Files files{root};
    platform::linux_::Preferences preferences{root, files};
    const std::string directory = root.users() + "/" + std::to_string(geteuid()) + "/Preferences";
};

struct FakePreferences {
    void store(const std::string& key, const Value& value) { preferences.store(domain, key, value); }
    void makeUnreadable() { preferences.isUnreadable = true; }
    support::FakePreferences preferences;
};

template <class World> class PreferencesConformance : public testing::Test {};
using Worlds = testing::Types<LinuxPreferences, FakePreferences>;
TYPED_TEST_SUITE(PreferencesConformance, Worlds);

TYPED_TEST(PreferencesConformance, SynchronizeTakesOverWhatIsStored) {
    TypeParam world;
    platform::Preferences& preferences = world.preferences;
    EXPECT_FALSE(preferences.synchronize(domain)) << "not before the domain is added";
    preferences.addDomain(domain);
    EXPECT_TRUE(preferences.synchronize(domain)) << "nothing was ever stored";
    Value former;
    for (const Value& stored : {Value("old"), Value("new"), Value(), Value("newest")}) {
        world.store("key", stored);
        EXPECT_EQ(preferences.value(domain, "key"), former) << "not before it is synchronized";
        EXPECT_TRUE(preferences.synchronize(domain));
        EXPECT_EQ(preferences.value(domain, "key"), stored);
        former = stored;
    }
    world.makeUnreadable();
    EXPECT_FALSE(preferences.synchronize(domain));
    EXPECT_FALSE(preferences.synchronize(domain)) << "nor the second time";
    EXPECT_EQ(preferences.value(domain, "key"), Value("newest"));
}

TEST(PreferencesFile, MustBeTheUsersOwn) {
    const auto content = [](const Value& value) {
        return [value](const auto& file) { support::writeFile(file, *platform::encodeXML(value)); };
    };
    std::vector<std::pair<const char*, std::function<void(const std::string& file)>>> cases{
        {"writable by others", [](const auto& file) { chmod(file.c_str(), 0622); }},
        {"in an open directory", [](const auto& file) { chmod(file.substr(0, file.rfind('/')).c_str(), 0755); }},
        {"too large", content(platform::Dictionary{{"key", std::string(1U << 20U, 'x')}})},
        {"no dictionary", content(platform::Array{"key"})},
        {"a link", support::putBehindLink},
    };
    if (geteuid() == 0) // only the superuser can give a file away
        cases.emplace_back("of another user", [](const auto& file) { (void)!chown(file.c_str(), 12345, 12345); });
    for (const auto& [what, deviate] : cases) {
        LinuxPreferences world;
        world.store("key", "value");
        deviate(world.file());
        world.preferences.addDomain(domain);
        EXPECT_FALSE(world.preferences.synchronize(domain)) << what;
        EXPECT_FALSE(world.preferences.value(domain, "key")) << what;
        EXPECT_TRUE(world.preferences.setValue(domain, "key", "other")) << what << " is not replaced";
    }
}

} // namespace
