#include "platform/linux/Preferences.h"
#include "platform/linux/Files.h"
#include "tests/support/PreferencesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <thread>

namespace {

using platform::Value;

constexpr const char* domain = "com.example.prefs";

struct LinuxPreferences {
    void store(const std::string& key, const Value& value) {
        platform::linux_::Preferences writer(root, files);
        EXPECT_FALSE(writer.setValue(domain, key, value));
    }
    void makeUnreadable() { std::ofstream(file()) << "not a property list"; }
    /// The domain's file, once something is stored.
    std::string file() const {
        for (const auto& entry : std::filesystem::directory_iterator(directory))
            if (entry.path().filename().string().starts_with(domain)) return entry.path().string();
        return "no file";
    }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::Files files{root};
    platform::linux_::Preferences preferences{root, files};
    std::string directory = root.users() + "/" + std::to_string(geteuid()) + "/Preferences";
};

struct FakePreferences {
    void store(const std::string& key, const Value& value) { preferences.store(domain, key, value); }
    void makeUnreadable() { preferences.isUnreadable = true; }
    support::FakePreferences preferences;
};

template <class World> class PreferencesConformance : public testing::Test {
protected:
    World world;
};
using Worlds = testing::Types<LinuxPreferences, FakePreferences>;
TYPED_TEST_SUITE(PreferencesConformance, Worlds);

TYPED_TEST(PreferencesConformance, SynchronizeTakesOverWhatIsStored) {
    platform::Preferences& preferences = this->world.preferences;
    this->world.store("key", "old");
    EXPECT_FALSE(preferences.synchronize(domain)) << "not before the domain is added";
    EXPECT_FALSE(preferences.value(domain, "key"));
    preferences.addDomain(domain);
    ASSERT_TRUE(preferences.synchronize(domain));
    EXPECT_EQ(preferences.value(domain, "key"), Value("old"));

    this->world.store("key", "new");
    EXPECT_EQ(preferences.value(domain, "key"), Value("old")) << "not before it is synchronized";
    ASSERT_TRUE(preferences.synchronize(domain));
    EXPECT_EQ(preferences.value(domain, "key"), Value("new"));
    this->world.store("key", Value());
    ASSERT_TRUE(preferences.synchronize(domain));
    EXPECT_FALSE(preferences.value(domain, "key"));
}

TYPED_TEST(PreferencesConformance, SynchronizeThatFailsKeepsTheValues) {
    platform::Preferences& preferences = this->world.preferences;
    preferences.addDomain(domain);
    EXPECT_TRUE(preferences.synchronize(domain)) << "nothing was ever stored";
    this->world.store("key", 1);
    ASSERT_TRUE(preferences.synchronize(domain));
    this->world.makeUnreadable();
    EXPECT_FALSE(preferences.synchronize(domain));
    EXPECT_FALSE(preferences.synchronize(domain)) << "nor the second time";
    EXPECT_EQ(preferences.value(domain, "key"), Value(1));
}

TEST(PreferencesFile, MustBeTheUsersOwn) {
    namespace fs = std::filesystem;
    using platform::encodeXML;
    const auto expectRefused = [](const char* what, const std::function<void(const std::string& file)>& deviate) {
        SCOPED_TRACE(what);
        LinuxPreferences world;
        world.store("key", "value");
        deviate(world.file());
        world.preferences.addDomain(domain);
        EXPECT_FALSE(world.preferences.synchronize(domain));
        EXPECT_FALSE(world.preferences.value(domain, "key"));
        EXPECT_TRUE(world.preferences.setValue(domain, "key", "other")) << "and is not replaced";
    };
    const std::string large(1U << 20U, 'x');
    expectRefused("writable by others", [](auto& file) { chmod(file.c_str(), 0622); });
    expectRefused("in an open directory",
                  [](auto& file) { fs::permissions(fs::path(file).parent_path(), fs::perms(0755)); });
    expectRefused("too large",
                  [&](auto& file) { std::ofstream(file) << *encodeXML(platform::Dictionary{{"key", large}}); });
    expectRefused("no dictionary", [](auto& file) { std::ofstream(file) << *encodeXML(platform::Array{"key"}); });
    expectRefused("a link", [](auto& file) {
        fs::rename(file, file + ".moved");
        fs::create_symlink(file + ".moved", file);
    });
    expectRefused("a pipe", [](auto& file) {
        fs::remove(file);
        mkfifo(file.c_str(), 0600);
    });
    if (geteuid() != 0) return; // only the superuser can give a file away
    expectRefused("of another user", [](auto& file) { ASSERT_EQ(chown(file.c_str(), 12345, 12345), 0); });
}

TEST(PreferencesDomain, MustBeAName) {
    LinuxPreferences world;
    for (const std::string name : {"", "..", "a/b", "../../x"}) {
        world.preferences.addDomain(name);
        EXPECT_FALSE(world.preferences.synchronize(name)) << name;
        EXPECT_TRUE(world.preferences.setValue(name, "key", 1)) << name;
    }
}

TEST(PreferencesSetValue, WritersTakeTurns) {
    LinuxPreferences world;
    std::vector<std::thread> threads;
    for (const std::string writer : {"a", "b", "c", "d"})
        threads.emplace_back([&world, writer] {
            for (int key = 0; key < 8; ++key) world.store(writer + std::to_string(key), key);
        });
    for (auto& thread : threads) thread.join();
    const auto stored = platform::decodePropertyList(*world.files.read(world.file(), 1U << 20U));
    ASSERT_TRUE(stored);
    EXPECT_EQ(stored->dictionary()->size(), 32U);
}

} // namespace
