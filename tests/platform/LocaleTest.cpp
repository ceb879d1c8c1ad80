#include "platform/linux/Locale.h"
#include "platform/PropertyList.h"
#include "platform/linux/Files.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/LocaleFake.h"
#include "tests/support/Mailbox.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

namespace {

using Languages = std::vector<std::string>;
using Calls = support::Mailbox<int>;

class LocaleTest : public testing::Test {
protected:
    auto observe(platform::Locale& observed, Calls& told) {
        return observed.observeChanges(queue, [&] { told.put(0); });
    }
    /// What holds of every implementation.
    void expectNoticesOfChanges(platform::Locale& observed, const std::function<void(const Languages&)>& setLanguages) {
        Calls others;
        auto observation = observe(observed, calls);
        setLanguages({"de", "pt-BR"});
        EXPECT_TRUE(calls.take());
        EXPECT_EQ(observed.languages(), (Languages{"de", "pt-BR", "en"}));
        setLanguages({"de", "pt-BR"});
        setLanguages({"it"});
        EXPECT_TRUE(calls.take());
        EXPECT_EQ(observed.languages(), (Languages{"it", "en"}));
        observation.reset();
        const auto other = observe(observed, others);
        setLanguages({"en", "sv", "en"});
        EXPECT_TRUE(others.take());
        queue->sync([] {});
        EXPECT_EQ(calls.size(), 0U) << "the same list again is no change";
    }

    platform::linux_::WorkQueues queues;
    std::shared_ptr<platform::WorkQueue> queue = queues.makeSerial("test", platform::QualityOfService::standard);
    Calls calls;
    support::ScratchDirectory scratch;
    platform::linux_::Root root{scratch.path()};
    platform::linux_::Files files{root};
    // One object changes the languages and another is asked, as in two processes.
    platform::linux_::Locale locale{root, files, {"fr"}};
    platform::linux_::Locale writer{root, files, {"fr"}};
};

TEST_F(LocaleTest, TellsObserversOfChangesOnly) {
    expectNoticesOfChanges(locale, [&](const Languages& languages) { EXPECT_FALSE(writer.setLanguages(languages)); });
    EXPECT_EQ(locale.languages(), (Languages{"en", "sv"})) << "preferred English stays in its place";
    support::FakeLocale twin;
    expectNoticesOfChanges(twin, [&](Languages languages) {
        languages.emplace_back("en");
        twin.setLanguages(languages);
    });
}

TEST_F(LocaleTest, FileMayBeMissingOrBroken) {
    const Languages fallback{"fr", "en"};
    const std::string file = root.database() + "/Locale.vlist";
    const auto fileOf = [](const platform::Value& value) { return *platform::encodeXML(value); };
    const auto listOf = [&](const platform::Array& list) { return fileOf(platform::Dictionary{{"languages", list}}); };
    const auto observation = observe(locale, calls);
    EXPECT_EQ(locale.languages(), fallback);
    EXPECT_FALSE(writer.setLanguages({"de"}));
    EXPECT_EQ(writer.languages(), (Languages{"de", "en"})) << "at once";
    EXPECT_TRUE(calls.take());
    for (const std::string& bytes :
         {std::string(), fileOf("de"), fileOf(platform::Dictionary{}), listOf({"it", 7}), listOf({"../../etc"}),
          listOf({std::string(36, 'a')}), listOf(platform::Array(std::vector<platform::Value>(33, "it")))}) {
        ASSERT_FALSE(files.writeAtomically(file, bytes));
        EXPECT_EQ(platform::linux_::Locale(root, files, {"fr"}).languages(), fallback) << bytes;
    }
    EXPECT_FALSE(writer.setLanguages({"sv"}));
    EXPECT_TRUE(calls.take());
    EXPECT_EQ(locale.languages(), (Languages{"sv", "en"})) << "the broken ones change nothing";
    std::filesystem::remove(file);
    while (locale.languages() != fallback) ASSERT_TRUE(calls.take());
}

TEST(LocaleName, LanguagesOfName) {
    const std::pair<const char*, Languages> cases[] = {{"de_DE.UTF-8", {"de-DE", "de"}},
                                                       {"ca_ES@valencia", {"ca-ES", "ca"}},
                                                       {"sv", {"sv"}},
                                                       {"C.UTF-8", {}},
                                                       {"POSIX", {}},
                                                       {"/etc/passwd", {}}};
    for (const auto& [text, languages] : cases)
        EXPECT_EQ(platform::linux_::Locale::languagesOfName(text), languages) << text;
}

} // namespace
