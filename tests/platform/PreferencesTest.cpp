#include "platform/linux/Preferences.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/Files.h"
#include "tests/support/PreferencesFake.h"
#include "tests/support/ScratchDirectory.h"

#include <chrono>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <thread>

namespace {

using platform::Value;

constexpr const char* domain = "com.example.prefs";

class LinuxPreferences {
public:
    platform::linux_::Preferences& preferences() { return _preferences; }
    void store(const std::string& key, const Value& value) {
        platform::linux_::Preferences writer(root, files);
        EXPECT_FALSE(writer.setValue(domain, key, value));
    }
    void makeUnreadable() { std::ofstream(file()) << "not a property list"; }
    /// The one file in the directory.
    std::string file() const {
        for (const auto& entry : std::filesystem::directory_iterator(directory())) {
            if (entry.path().filename().string().starts_with(domain)) return entry.path().string();
        }
        ADD_FAILURE() << "no file in " << directory();
        return {};
    }
    std::string directory() const { return root.users() + "/" + std::to_string(geteuid()) + "/Preferences"; }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::Files files{root};

private:
    platform::linux_::Preferences _preferences{root, files};
};

class FakePreferences {
public:
    platform::Preferences& preferences() { return _preferences; }
    void store(const std::string& key, const Value& value) { _preferences.store(domain, key, value); }
    void makeUnreadable() { _preferences.isUnreadable = true; }

private:
    support::FakePreferences _preferences;
};

template <class World> class PreferencesConformance : public testing::Test {
protected:
    World world;
};
using Worlds = testing::Types<LinuxPreferences, FakePreferences>;
TYPED_TEST_SUITE(PreferencesConformance, Worlds);

TYPED_TEST(PreferencesConformance, SynchronizeTakesOverWhatIsStored) {
    auto& preferences = this->world.preferences();
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
    auto& preferences = this->world.preferences();
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
    const std::pair<const char*, std::function<void(LinuxPreferences&)>> deviations[] = {
        {"writable by others", [](auto& world) { chmod(world.file().c_str(), 0622); }},
        {"in an open directory", [](auto& world) { chmod(world.directory().c_str(), 0755); }},
        {"a link",
         [](auto& world) {
             const std::string file = world.file();
             std::filesystem::rename(file, world.scratch / "elsewhere");
             std::filesystem::create_symlink(world.scratch / "elsewhere", file);
         }},
        {"a pipe",
         [](auto& world) {
             const std::string file = world.file();
             std::filesystem::remove(file);
             mkfifo(file.c_str(), 0600);
         }},
        {"too large",
         [](auto& world) {
             std::ofstream(world.file()) << *platform::encodeXML(
                 platform::Dictionary{{"key", std::string(1U << 20U, 'x')}});
         }},
        {"no dictionary",
         [](auto& world) { std::ofstream(world.file()) << *platform::encodeXML(platform::Array{"key"}); }},
    };
    for (const auto& [name, deviate] : deviations) {
        SCOPED_TRACE(name);
        LinuxPreferences world;
        world.store("key", "value");
        deviate(world);
        world.preferences().addDomain(domain);
        EXPECT_FALSE(world.preferences().synchronize(domain));
        EXPECT_FALSE(world.preferences().value(domain, "key"));
        EXPECT_TRUE(world.preferences().setValue(domain, "key", "other")) << "and is not replaced";
    }
}

TEST(PreferencesFile, OfAnotherUserIsRefused) {
    if (geteuid() != 0) GTEST_SKIP() << "only the superuser can give a file away";
    LinuxPreferences world;
    world.store("key", "value");
    ASSERT_EQ(chown(world.file().c_str(), 12345, 12345), 0);
    world.preferences().addDomain(domain);
    EXPECT_FALSE(world.preferences().synchronize(domain));
}

TEST(PreferencesDomain, MustBeAName) {
    LinuxPreferences world;
    for (const std::string name : {"", "..", "a/b", "../../x"}) {
        world.preferences().addDomain(name);
        EXPECT_FALSE(world.preferences().synchronize(name)) << name;
        EXPECT_TRUE(world.preferences().setValue(name, "key", 1)) << name;
    }
}

TEST(PreferencesSynchronize, DoesNotOpenAnUnchangedFile) {
    LinuxPreferences world;
    world.store("key", "value");
    world.preferences().addDomain(domain);
    const platform::linux_::Descriptor inotify(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
    ASSERT_GE(inotify_add_watch(inotify.get(), world.file().c_str(), IN_OPEN), 0);
    const auto isOpened = [&] {
        EXPECT_TRUE(world.preferences().synchronize(domain));
        char events[4096];
        return read(inotify.get(), events, sizeof events) > 0;
    };
    EXPECT_TRUE(isOpened());
    // While the file is as young as a tick of the clock it is read each time.
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (isOpened()) ASSERT_LT(std::chrono::steady_clock::now(), deadline);
    EXPECT_EQ(world.preferences().value(domain, "key"), Value("value"));
}

TEST(PreferencesSetValue, WritersTakeTurns) {
    LinuxPreferences world;
    constexpr int writers = 4;
    constexpr int keys = 8;
    std::vector<std::thread> threads;
    threads.reserve(writers);
    for (int writer = 0; writer < writers; ++writer) {
        threads.emplace_back([&world, writer] {
            for (int key = 0; key < keys; ++key) world.store(std::to_string(writer * keys + key), key);
        });
    }
    for (auto& thread : threads) thread.join();
    world.preferences().addDomain(domain);
    ASSERT_TRUE(world.preferences().synchronize(domain));
    for (int key = 0; key < writers * keys; ++key) {
        EXPECT_TRUE(world.preferences().value(domain, std::to_string(key))) << key;
    }
}

} // namespace
