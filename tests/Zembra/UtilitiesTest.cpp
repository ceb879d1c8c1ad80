#include "Zembra/AtomicField.h"
#include "Zembra/ZBLog.h"
#include "Zembra/ZBUtilities.h"
#include "platform/Hashing.h"
#include "tests/support/SystemLogFake.h"
#include "zbd/ZBDPlugInSignature.h"

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

TEST(Utilities, ChangeACopyAndLeaveOutAbsentResults) {
    const Dictionary original{{"a", 1}, {"b", 2}};
    EXPECT_EQ(zembra::dictionaryChanging(original, "b", 3), (Dictionary{{"a", 1}, {"b", 3}}));
    EXPECT_EQ(zembra::dictionaryChanging(original, "a", Value()), (Dictionary{{"b", 2}}));
    EXPECT_FALSE(zembra::dictionaryChanging(original, "c", Value())->sharesStorageWith(original));
    EXPECT_EQ(zembra::dictionaryChanging(std::nullopt, "a", 1), std::nullopt);
    EXPECT_EQ(original, (Dictionary{{"a", 1}, {"b", 2}}));
    const auto squareOfOdd = [](int number) { return number % 2 == 1 ? Value(number * number) : Value(); };
    EXPECT_EQ(zembra::arrayWithValues(std::vector{3, 2, 1}, squareOfOdd), (Array{9, 1}));
}

TEST(AtomicField, ReaderKeepsAWholeValueWhileAnotherReplacesIt) {
    zembra::AtomicField<std::string> field(std::string(100, 'a'));
    std::atomic<bool> stop = false;
    std::thread writer([&] {
        for (char letter = 'a'; !stop; letter = static_cast<char>(letter ^ 1)) field.set(std::string(100, letter));
    });
    for (int i = 0; i < 20'000; ++i) {
        const std::string value = field.get();
        EXPECT_EQ(value, std::string(100, value.front()));
    }
    stop = true;
    writer.join();
}

TEST(PlugInSignature, HashDiffersAndRequirementStays) {
    Failure error;
    const auto first = zbd::ZBDPlugInSignature::initWithURL(URL::file("/Some.appex"), &error);
    EXPECT_EQ(error, std::nullopt);
    EXPECT_EQ(first->cdhash().size(), 20U);
    EXPECT_NE(first->cdhash(), zbd::ZBDPlugInSignature::initWithURL(URL::file("/Some.appex"), nullptr)->cdhash());
    EXPECT_EQ(first->requirement(), "dummy requirement");
    // The published example of FIPS 180-2, appendix A.1.
    EXPECT_EQ(sha1("abc"), "\xA9\x99\x3E\x36\x47\x06\x81\x6A\xBA\x3E\x25\x71\x78\x50\xC2\x6C\x9C\xD0\xD8\x9D");
}

TEST(Log, ChannelsAreHandlesOfTheirCategory) {
    for (const auto& [channel, category] : {std::pair(&zembra::log::ops, "ops"),
                                            {zembra::log::traffic, "traffic"},
                                            {zembra::log::extension, "extension"},
                                            {zembra::log::cx, "cx"},
                                            {zembra::log::sandbox, "sandbox"}}) {
        EXPECT_EQ(channel().category(), category);
        EXPECT_EQ(channel().subsystem(), "com.nordane.Zembra");
    }
}

TEST(Log, RefusedCategoriesUseTheDefaultLog) {
    GTEST_FLAG_SET(death_test_style, "threadsafe"); // channels are made once per process, so this takes a fresh one
    EXPECT_EXIT(
        {
            support::processLog.refuse("cx");
            for (int i = 0; i < 2; ++i) zembra::log::cx().info("line");
            for (const auto& [category, level, message] : support::processLog.lines())
                std::fprintf(stderr, "<%s %d %s>", category.c_str(), static_cast<int>(level), message.c_str());
            std::exit(0);
        },
        testing::ExitedWithCode(0), "^< 3 unable to create tracelog for category cx>< 1 line>< 1 line>$");
}

} // namespace
