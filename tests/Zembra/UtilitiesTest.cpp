#include "Zembra/AtomicField.h"
#include "Zembra/ZBUtilities.h"
#include "platform/Hashing.h"
#include "zbd/ZBDPlugInSignature.h"

#include <gtest/gtest.h>
#include <thread>

namespace {

using namespace platform;
using zembra::compareVersionString;

TEST(CompareVersionString, OrdersByNumberThenByCharacter) {
    // Each text sorts after those before it, whichever way they are asked. The last is an Arabic digit one.
    const std::string beyond[] = {"18446744073709551615", "18446744073709551616", "100000000000000000000000"};
    const std::string ascending[] = {"",        ".",      "0",       "1",        "1.",      "1.2",     "1.9",
                                     "1.10",    "1.10b2", "1.10b10", "2",        "10",      beyond[0], beyond[1],
                                     beyond[2], "a",      "a1",      "\xC3\xA9", "\xD9\xA1"};
    for (std::size_t i = 0; i < std::size(ascending); ++i) {
        for (std::size_t j = 0; j < std::size(ascending); ++j) {
            EXPECT_TRUE(compareVersionString(ascending[i], ascending[j]) == (i <=> j))
                << '"' << ascending[i] << "\" against \"" << ascending[j] << '"';
        }
    }
    for (const auto& [left, right] :
         {std::pair("01", "1"), std::pair("1.00", "1.0"), std::pair("000", "0"), std::pair("2.007b01", "2.7b1")}) {
        EXPECT_TRUE(compareVersionString(left, right) == 0) << left << " against " << right;
    }
    EXPECT_TRUE(compareVersionString("009", "10") < 0);
    EXPECT_TRUE(compareVersionString("00", "") > 0);
    // What follows the equal numbers still counts.
    EXPECT_TRUE(compareVersionString("01.2", "1.1") > 0);
}

TEST(DictionaryChanging, SetsAndRemovesInACopy) {
    const Dictionary original{{"a", 1}, {"b", 2}};
    EXPECT_EQ(zembra::dictionaryChanging(original, "b", 3), (Dictionary{{"a", 1}, {"b", 3}}));
    EXPECT_EQ(zembra::dictionaryChanging(original, "a", Value()), (Dictionary{{"b", 2}}));
    EXPECT_FALSE(zembra::dictionaryChanging(original, "c", Value())->sharesStorageWith(original));
    EXPECT_EQ(zembra::dictionaryChanging(std::nullopt, "a", 1), std::nullopt);
    EXPECT_EQ(original, (Dictionary{{"a", 1}, {"b", 2}}));
}

TEST(ArrayWithValues, KeepsTheOrderAndLeavesOutAbsentResults) {
    const auto oddSquares = zembra::arrayWithValues(
        std::vector{3, 2, 1}, [](int number) { return number % 2 == 1 ? Value(number * number) : Value(); });
    EXPECT_EQ(oddSquares, (Array{9, 1}));
}

TEST(ErrorWithCode, FillsTheDescription) {
    EXPECT_EQ(zembra::errorWithCode(4), (Error{"Zembra", 4, std::nullopt}));
    EXPECT_EQ(zembra::errorWithCode(-1, "100%"), (Error{"Zembra", -1, "100%"}));
    EXPECT_EQ(zembra::errorWithCode(7, "version %d of %@", 2, std::string("it")),
              (Error{"Zembra", 7, "version 2 of it"}));
}

TEST(AtomicField, ReaderKeepsAWholeValueWhileOthersReplaceIt) {
    zembra::AtomicField<std::string> field(std::string(100, 'a'));
    std::atomic<bool> stop = false;
    std::vector<std::thread> writers;
    for (const char letter : {'b', 'c'}) {
        writers.emplace_back([&, letter] {
            while (!stop) field.set(std::string(100, letter));
        });
    }
    for (int i = 0; i < 20'000; ++i) {
        const std::string value = field.get();
        ASSERT_EQ(value, std::string(100, value.front()));
    }
    stop = true;
    for (auto& writer : writers) writer.join();
}

TEST(PlugInSignature, HashDiffersAndRequirementStays) {
    const auto url = URL::file("/Applications/Some.app/PlugIns/Some.appex");
    Failure error;
    const auto first = zbd::ZBDPlugInSignature::initWithURL(url, &error);
    const auto second = zbd::ZBDPlugInSignature::initWithURL(url, nullptr);
    EXPECT_EQ(error, std::nullopt);
    EXPECT_EQ(first->cdhash().size(), 20U);
    EXPECT_NE(first->cdhash(), second->cdhash());
    EXPECT_EQ(first->requirement(), "dummy requirement");
}

TEST(Sha1, MatchesThePublishedExample) {
    // FIPS 180-2, appendix A.1.
    EXPECT_EQ(platform::sha1("abc"),
              "\xA9\x99\x3E\x36\x47\x06\x81\x6A\xBA\x3E\x25\x71\x78\x50\xC2\x6C\x9C\xD0\xD8\x9D");
}

} // namespace
