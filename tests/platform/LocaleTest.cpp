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
class LinuxLocale {
public:
    platform::Locale& locale() { return _locale; }
    void setLanguages(const Languages& languages) { EXPECT_FALSE(_writer.setLanguages(languages)); }
    platform::linux_::Locale& writer() { return _writer; }

    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::Files files{root};

private:
    platform::linux_::Locale _locale{root, files, {"fr"}};
    platform::linux_::Locale _writer{root, files, {"fr"}};
};

class FakeLocale {
public:
    platform::Locale& locale() { return _locale; }
    void setLanguages(Languages languages) {
        languages.emplace_back("en");
        _locale.setLanguages(languages);
    }

private:
    support::FakeLocale _locale;
};

template <class World> class LocaleConformance : public testing::Test {
protected:
    platform::linux_::WorkQueues queues;
    std::shared_ptr<platform::WorkQueue> queue = queues.makeSerial("test", platform::QualityOfService::standard);
    World world;
};
using Worlds = testing::Types<LinuxLocale, FakeLocale>;
TYPED_TEST_SUITE(LocaleConformance, Worlds);

TYPED_TEST(LocaleConformance, ObserversAreToldAfterChangesOnly) {
    CallCounter calls;
    auto observation = this->world.locale().observeChanges(this->queue, [&] { calls.call(); });
    this->world.setLanguages({"de", "pt-BR"});
    ASSERT_TRUE(calls.waitFor(1));
    EXPECT_EQ(this->world.locale().languages(), (Languages{"de", "pt-BR", "en"}));
    this->world.setLanguages({"de", "pt-BR"});
    this->world.setLanguages({"it"});
    ASSERT_TRUE(calls.waitFor(2));
    EXPECT_EQ(this->world.locale().languages(), (Languages{"it", "en"}));
    this->queue->sync([] {});
    EXPECT_EQ(calls.count(), 2) << "the same list again is no change";

    CallCounter others;
    observation.reset();
    const auto other = this->world.locale().observeChanges(this->queue, [&] { others.call(); });
    this->world.setLanguages({"sv"});
    ASSERT_TRUE(others.waitFor(1));
    this->queue->sync([] {});
    EXPECT_EQ(calls.count(), 2);
}

class LocaleFile : public LocaleConformance<LinuxLocale> {};

TEST_F(LocaleFile, WhileThereIsNoneTheFallbackCounts) {
    EXPECT_EQ(world.locale().languages(), (Languages{"fr", "en"}));
    world.setLanguages({"de"});
    CallCounter calls;
    const auto observation = world.locale().observeChanges(queue, [&] { calls.call(); });
    EXPECT_EQ(world.writer().languages(), (Languages{"de", "en"}));
    std::filesystem::remove(world.root.database() + "/Locale.vlist");
    while (world.locale().languages() != Languages{"fr", "en"}) ASSERT_TRUE(calls.waitFor(calls.count() + 1));
}

TEST_F(LocaleFile, BrokenOnesChangeNothing) {
    world.setLanguages({"de"});
    const auto fileOf = [](const platform::Value& value) { return *platform::encodeXML(value); };
    const auto listOf = [&](const platform::Array& list) { return fileOf(platform::Dictionary{{"languages", list}}); };
    for (const std::string& bytes :
         {std::string(), fileOf("de"), fileOf(platform::Dictionary{}), listOf({"it", 7}), listOf({"../../etc"}),
          listOf({std::string(36, 'a')}), listOf(platform::Array(std::vector<platform::Value>(33, "it")))}) {
        ASSERT_FALSE(world.files.writeAtomically(world.root.database() + "/Locale.vlist", bytes));
        platform::linux_::Locale fresh(world.root, world.files, {"fr"});
        EXPECT_EQ(fresh.languages(), (Languages{"fr", "en"})) << bytes;
    }
    CallCounter calls;
    const auto observation = world.locale().observeChanges(queue, [&] { calls.call(); });
    const auto before = world.locale().languages();
    world.files.writeAtomically(world.root.database() + "/Locale.vlist", "broken");
    world.setLanguages({"sv"});
    ASSERT_TRUE(calls.waitFor(1));
    EXPECT_EQ(world.locale().languages(), (Languages{"sv", "en"}));
}

TEST_F(LocaleFile, SetLanguagesShowsAtOnceAndKeepsPreferredEnglishInItsPlace) {
    ASSERT_FALSE(world.writer().setLanguages({"en", "de", "en"}));
    EXPECT_EQ(world.writer().languages(), (Languages{"en", "de"}));
    for (const char* refused : {"", "a/b", "..", "-de", "d\xc3\xa9"}) {
        EXPECT_TRUE(world.writer().setLanguages({refused})) << refused;
    }
    EXPECT_TRUE(world.writer().setLanguages(Languages(33, "de")));
    EXPECT_EQ(world.writer().languages(), (Languages{"en", "de"}));
}

TEST(LocaleName, LanguagesOfName) {
    const std::pair<const char*, Languages> cases[] = {{"de_DE.UTF-8", {"de-DE", "de"}},
                                                       {"ca_ES@valencia", {"ca-ES", "ca"}},
                                                       {"sv", {"sv"}},
                                                       {"C", {}},
                                                       {"C.UTF-8", {}},
                                                       {"POSIX", {}},
                                                       {"/etc/passwd", {}},
                                                       {"", {}}};
    for (const auto& [text, languages] : cases) {
        EXPECT_EQ(platform::linux_::Locale::languagesOfName(text), languages) << text;
    }
}

} // namespace
