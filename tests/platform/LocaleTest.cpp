#include "platform/linux/Locale.h"
#include "platform/linux/Files.h"
#include "platform/linux/WorkQueue.h"
#include "tests/support/BundleTree.h"
#include "tests/support/Mailbox.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

namespace {

using platform::linux_::Locale;
using Languages = std::vector<std::string>;

TEST(Locale, TellsObserversOfChangesOnly) {
    const Languages fallback{"fr", "en"};
    const support::ScratchDirectory scratch;
    const platform::linux_::Root root(scratch.path());
    const std::string file = root.database() + "/Locale.vlist";
    platform::linux_::WorkQueues queues;
    const auto queue = queues.makeSerial("test", platform::QualityOfService::standard);
    platform::linux_::Files files(root);
    support::Mailbox<Languages> told;
    Locale locale(root, files, {"fr"});
    const auto observation = locale.observeChanges(queue, [&] { told.put(locale.languages()); });
    const auto listOf = [](const platform::Array& languages) {
        return *platform::encodeXML(platform::Dictionary{{"languages", languages}});
    };
    for (const auto& [list, expected] : {std::pair<platform::Array, Languages>{{"de", "pt-BR"}, {"de", "pt-BR", "en"}},
                                         {{"en", "sv", "en"}, {"en", "sv"}}}) {
        support::writeFile(file, listOf(list));
        EXPECT_EQ(told.take(), expected);
        support::writeFile(file, listOf(list)); // no change, so nothing more is told
    }
    for (const std::string& bytes :
         {std::string(), *platform::encodeXML("de"), listOf({"it", 7}), listOf({"../../etc"}),
          listOf({std::string(36, 'a')}), listOf(platform::Array(std::vector<platform::Value>(33, "it")))}) {
        support::writeFile(file, bytes);
        EXPECT_EQ(Locale(root, files, {"fr"}).languages(), fallback) << bytes;
    }
    std::filesystem::remove(file);
    EXPECT_EQ(told.take(), fallback);
    queue->sync([] {});
    EXPECT_EQ(told.size(), 0U);
}

} // namespace
