#include "platform/linux/Locale.h"
#include "platform/linux/Files.h"
#include "tests/support/BundleTree.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

namespace {

using platform::linux_::Locale;
using Languages = std::vector<std::string>;

TEST(Locale, ListsWhatIsWellFormedAndElseTheEnvironments) {
    const support::ScratchDirectory scratch;
    const platform::linux_::Root root(scratch.path());
    platform::linux_::Files files(root);
    const auto listOf = [](const platform::Array& languages) {
        return *platform::encodeXML(platform::Dictionary{{"languages", languages}});
    };
    const Languages fallback{"fr", "en"};
    const std::pair<std::string, Languages> cases[] = {
        {listOf({"de", "pt-BR"}), {"de", "pt-BR", "en"}},
        {listOf({"en", "sv", "en"}), {"en", "sv"}},
        {*platform::encodeXML("de"), fallback},
        {listOf({"it", 7}), fallback},
        {listOf({"../../etc"}), fallback},
        {listOf({std::string(36, 'a')}), fallback},
        {listOf(platform::Array(std::vector<platform::Value>(33, "it"))), fallback},
    };
    for (const auto& [bytes, languages] : cases) {
        support::writeFile(root.database() + "/Locale.vlist", bytes);
        EXPECT_EQ(Locale(root, files, {"fr"}).languages(), languages) << bytes;
    }
}

} // namespace
