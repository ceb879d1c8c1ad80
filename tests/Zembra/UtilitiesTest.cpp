#include "Zembra/AtomicField.h"
#include "Zembra/ZBUtilities.h"
#include "platform/Hashing.h"

#include <gtest/gtest.h>
#include <sstream>
#include <thread>

namespace {

using namespace platform;
using zembra::compareVersionString;

TEST(CompareVersionString, OrdersByNumberThenByCharacter) {
    // Each text sorts after those before it, whichever way they are asked. The last is an Arabic digit one.
    std::istringstream words(". 0 1 1. 1.2 1.9 1.10 1.10b2 1.10b10 2 009 10 18446744073709551615 18446744073709551616 "
                             "100000000000000000000000 a a1 \xC3\xA9 \xD9\xA1");
    std::vector<std::string> ascending{""};
    for (std::string word; words >> word;) ascending.push_back(word);
    for (const auto& left : ascending)
        for (const auto& right : ascending)
            EXPECT_TRUE(compareVersionString(left, right) == (&left <=> &right)) << left << " against " << right;
    for (const auto& [left, right] : {std::pair("01", "1"), {"1.00", "1.0"}, {"000", "0"}, {"2.007b01", "2.7b1"}})
        EXPECT_TRUE(compareVersionString(left, right) == 0) << left << " against " << right;
    EXPECT_TRUE(compareVersionString("01.2", "1.1") > 0) << "what follows the equal numbers still counts";
}

TEST(AtomicField, ReaderKeepsAWholeValueWhileAnotherReplacesIt) {
    zembra::AtomicField<std::string> field(std::string(100, 'a'));
    const std::jthread writer([&](const std::stop_token& stop) {
        for (int i = 0; !stop.stop_requested(); ++i) field.set(std::string(100, i % 2 == 0 ? 'b' : 'c'));
    });
    for (int i = 0; i < 20'000; ++i) {
        const std::string value = field.get();
        EXPECT_EQ(value, std::string(100, value.front()));
    }
}

TEST(SHA1, AnswersThePublishedExample) { // of FIPS 180-2, appendix A.1
    EXPECT_EQ(sha1("abc"), "\xA9\x99\x3E\x36\x47\x06\x81\x6A\xBA\x3E\x25\x71\x78\x50\xC2\x6C\x9C\xD0\xD8\x9D");
}

} // namespace
