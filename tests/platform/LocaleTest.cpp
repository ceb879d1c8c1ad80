#include "platform/linux/Locale.h"
#include "platform/PropertyList.h"
#include "platform/linux/Files.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/CallCounter.h"
#include "tests/support/LocaleFake.h"
#include "tests/support/ScratchDirectory.h"

#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>

namespace {

using Languages = std::vector<std::string>;
using support::CallCounter;

/// One object changes the languages and another is asked, as in two processes.
struct LinuxLocale {
    void setLanguages(const Languages& languages) { EXPECT_FALSE(writer.setLanguages(languages)); }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::Files files{root};
    platform::linux_::Locale locale{root, files, {"fr"}};
    platform::linux_::Locale writer{root, files, {"fr"}};
    std::string file = root.database() + "/Locale.vlist";
};

struct FakeLocale {
    void setLanguages(Languages languages) {
        languages.emplace_back("en");
        locale.setLanguages(languages);
    }
    support::FakeLocale locale;
};

template <class World> class LocaleConformance : public testing::Test {
protected:
    platform::linux_::WorkQueues queues;
    std::shared_ptr<platform::WorkQueue> queue = queues.makeSerial("test", platform::QualityOfService::standard);
    std::unique_ptr<platform::LocaleObservation> observe(CallCounter& calls) {
        return world.locale.observeChanges(queue, [&] { calls.call(); });
    }
    World world;
};
using Worlds = testing::Types<LinuxLocale, FakeLocale>;
TYPED_TEST_SUITE(LocaleConformance, Worlds);

TYPED_TEST(LocaleConformance, ObserversAreToldAfterChangesOnly) {
    CallCounter calls;
    CallCounter others;
    auto observation = this->observe(calls);
    this->world.setLanguages({"de", "pt-BR"});
    ASSERT_TRUE(calls.waitFor(1));
    EXPECT_EQ(this->world.locale.languages(), (Languages{"de", "pt-BR", "en"}));
    this->world.setLanguages({"de", "pt-BR"});
    this->world.setLanguages({"it"});
    ASSERT_TRUE(calls.waitFor(2));
    EXPECT_EQ(this->world.locale.languages(), (Languages{"it", "en"}));
    observation.reset();
    const auto other = this->observe(others);
    this->world.setLanguages({"sv"});
    ASSERT_TRUE(others.waitFor(1));
    this->queue->sync([] {});
    EXPECT_EQ(calls.count(), 2) << "the same list again is no change";
}

class LocaleFile : public LocaleConformance<LinuxLocale> {
protected:
    CallCounter calls;
    const Languages fallback{"fr", "en"};
};

TEST_F(LocaleFile, WhileThereIsNoneTheFallbackCounts) {
    EXPECT_EQ(world.locale.languages(), fallback);
    world.setLanguages({"de"});
    const auto observation = observe(calls);
    EXPECT_EQ(world.writer.languages(), (Languages{"de", "en"}));
    std::filesystem::remove(world.file);
    while (world.locale.languages() != fallback) ASSERT_TRUE(calls.waitFor(calls.count() + 1));
}

TEST_F(LocaleFile, BrokenOnesChangeNothing) {
    world.setLanguages({"de"});
    const auto fileOf = [](const platform::Value& value) { return *platform::encodeXML(value); };
    const auto listOf = [&](const platform::Array& list) { return fileOf(platform::Dictionary{{"languages", list}}); };
    for (const std::string& bytes :
         {std::string(), fileOf("de"), fileOf(platform::Dictionary{}), listOf({"it", 7}), listOf({"../../etc"}),
          listOf({std::string(36, 'a')}), listOf(platform::Array(std::vector<platform::Value>(33, "it")))}) {
        ASSERT_FALSE(world.files.writeAtomically(world.file, bytes));
        EXPECT_EQ(platform::linux_::Locale(world.root, world.files, {"fr"}).languages(), fallback) << bytes;
    }
    const auto observation = observe(calls);
    world.files.writeAtomically(world.file, "broken");
    world.setLanguages({"sv"});
    ASSERT_TRUE(calls.waitFor(1));
    EXPECT_EQ(world.locale.languages(), (Languages{"sv", "en"}));
}

TEST_F(LocaleFile, SetLanguagesShowsAtOnceAndKeepsPreferredEnglishInItsPlace) {
    world.setLanguages({"en", "de", "en"});
    for (const char* refused : {"", "a/b", "..", "-de", "d\xc3\xa9"})
        EXPECT_TRUE(world.writer.setLanguages({refused})) << refused;
    EXPECT_TRUE(world.writer.setLanguages(Languages(33, "de")));
    EXPECT_EQ(world.writer.languages(), (Languages{"en", "de"}));
}

TEST(LocaleName, LanguagesOfName) {
    const std::pair<const char*, Languages> cases[] = {{"de_DE.UTF-8", {"de-DE", "de"}},
                                                       {"ca_ES@valencia", {"ca-ES", "ca"}},
                                                       {"sv", {"sv"}},
                                                       {"C.UTF-8", {}},
                                                       {"POSIX", {}},
                                                       {"/etc/passwd", {}},
                                                       {"", {}}};
    for (const auto& [text, languages] : cases)
        EXPECT_EQ(platform::linux_::Locale::languagesOfName(text), languages) << text;
}

} // namespace
