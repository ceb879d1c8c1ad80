#include "platform/PropertyList.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <random>
#include <thread>

namespace {

using namespace platform;
using namespace std::string_literals;

constexpr auto int64Max = std::numeric_limits<std::int64_t>::max();
constexpr auto int64Min = std::numeric_limits<std::int64_t>::min();
constexpr auto uint64Max = std::numeric_limits<std::uint64_t>::max();
constexpr double infinity = std::numeric_limits<double>::infinity();
constexpr double notANumber = std::numeric_limits<double>::quiet_NaN();

std::string compact(const Value& value) {
    std::string bytes;
    appendCompact(bytes, value);
    return bytes;
}

/// The encoding of a string with these very bytes, good or bad.
std::string compactText(const std::string& text) {
    std::string bytes = "\x07";
    for (unsigned shift = 0; shift < 32; shift += 8) bytes += static_cast<char>(text.size() >> shift & 0xFFU);
    return bytes + text;
}

std::string xml(const std::string& content) { return "<vlist>" + content + "</vlist>"; }

/// Arrays in one another, `depth` of them.
Value nested(std::size_t depth) {
    Value value = "core";
    for (std::size_t i = 0; i < depth; ++i) value = i % 2 == 0 ? Value(Array{value}) : Value(Dictionary{{"k", value}});
    return value;
}

/// Random trees with all kinds in them, the same ones in every run.
class Trees {
public:
    explicit Trees(UUIDs uuids) : _uuids(uuids) {}

    Value next(int depth = 0) {
        switch (below(depth < 4 ? 10 : 8)) {
        case 0: return below(2) == 0;
        case 1: return static_cast<std::int64_t>(_random() >> below(64));
        case 2: return static_cast<std::uint64_t>(_random()) | (1ULL << 63U);
        case 3: return std::ldexp(static_cast<double>(_random()), static_cast<int>(below(200)) - 100);
        case 4:
            return Date{std::ldexp(static_cast<double>(static_cast<std::int64_t>(_random())),
                                   -static_cast<int>(below(60)) - 28)};
        case 5: return Value::data(text());
        case 6:
            if (_uuids == UUIDs::allowed) {
                UUID uuid;
                for (auto& byte : uuid.bytes) byte = static_cast<std::uint8_t>(_random());
                return uuid;
            }
            [[fallthrough]];
        case 7: return text();
        case 8: {
            MutableArray array;
            for (auto i = below(6); i > 0; --i) array.append(next(depth + 1));
            return array;
        }
        default: {
            MutableDictionary dictionary;
            for (auto i = below(30); i > 0; --i) dictionary.set(text(), next(depth + 1));
            return dictionary;
        }
        }
    }

private:
    std::uint64_t below(std::uint64_t limit) { return _random() % limit; }

    std::string text() {
        static const char* const pieces[] = {"a",  "Zembra", "é", "…",   "😀",   "&<>\"'",
                                             "\r", "\n\t",   " ", "]]>", "\x7F", ""};
        std::string text;
        for (auto i = below(5); i > 0; --i) text += pieces[below(std::size(pieces))];
        return text;
    }

    std::mt19937_64 _random{20261122};
    UUIDs _uuids;
};

// Values and handles.

TEST(Value, AnswersItsOwnKindOnly) {
    EXPECT_FALSE(Value());
    EXPECT_EQ(Value(7).int64(), 7);
    EXPECT_EQ(Value(7).uint64(), 7U);
    EXPECT_EQ(Value(-7).uint64(), std::nullopt);
    EXPECT_EQ(Value(uint64Max).int64(), std::nullopt);
    EXPECT_EQ(Value(uint64Max).uint64(), uint64Max);
    EXPECT_EQ(Value(true).int64(), std::nullopt);
    EXPECT_EQ(Value(1).boolean(), std::nullopt);
    EXPECT_EQ(Value(1).real(), std::nullopt);
    EXPECT_EQ(Value("text").data(), std::nullopt);
    EXPECT_EQ(Value::data("text").string(), std::nullopt);
    EXPECT_EQ(Value::data("a\0b"s).data(), "a\0b"s);
    EXPECT_FALSE(Value(Dictionary()).array());
    EXPECT_FALSE(Value(Array()).dictionary());
}

TEST(Value, ReadsAnyNumberAsIntegerAndBoolean) {
    const struct {
        Value value;
        std::optional<std::int64_t> integer;
        std::optional<bool> boolean;
    } cases[] = {
        {true, 1, true},
        {false, 0, false},
        {-3, -3, true},
        {uint64Max, -1, true},
        {2.9, 2, true},
        {-2.9, -2, true},
        {0.5, 0, true},
        {-0.0, 0, false},
        {1e300, int64Max, true},
        {-1e300, int64Min, true},
        {9223372036854775808.0, int64Max, true},
        {infinity, int64Max, true},
        {notANumber, 0, true},
        {"1", std::nullopt, std::nullopt},
        {Date{1}, std::nullopt, std::nullopt},
        {Value(), std::nullopt, std::nullopt},
    };
    for (const auto& [value, integer, boolean] : cases) {
        EXPECT_EQ(value.integerValue(), integer) << value.description();
        EXPECT_EQ(value.booleanValue(), boolean) << value.description();
    }
}

TEST(ValueEquality, NumbersCompareByExactValue) {
    const struct {
        Value left, right;
        bool areEqual;
    } cases[] = {
        {1, true, true},
        {1.0, true, true},
        {0, false, true},
        {2, true, false},
        {1, 1.0, true},
        {-0.0, 0, true},
        {1, 1.5, false},
        {-1, uint64Max, false},
        {uint64Max, 18446744073709551616.0, false},
        {uint64Max - 2047, 18446744073709549568.0, true},
        {int64Max, 9223372036854775808.0, false},
        {1ULL << 63U, 9223372036854775808.0, true},
        {int64Min, -9223372036854775808.0, true},
        {(1LL << 53) + 1, 9007199254740992.0, false},
        {infinity, infinity, true},
        {infinity, uint64Max, false},
        {notANumber, notANumber, false},
        {notANumber, 0, false},
        {"1", 1, false},
        {Date{1}, 1, false},
        {Date{1.5}, Date{1.5}, true},
        {"a", Value::data("a"), false},
        {Value(), Value(), true},
        {Value(), false, false},
        {Array{1, "a"}, Array{true, "a"}, true},
        {Array{1, "a"}, Array{"a", 1}, false},
        {Array{}, Dictionary{}, false},
        {Dictionary{{"a", 1}, {"b", 2}}, Dictionary{{"b", 2.0}, {"a", true}}, true},
        {Dictionary{{"a", 1}}, Dictionary{{"b", 1}}, false},
        {Dictionary{{"a", 1}}, Dictionary{{"a", 1}, {"b", 1}}, false},
        {nested(70), nested(70), true},
        {nested(70), nested(69), false},
    };
    for (const auto& [left, right, areEqual] : cases) {
        EXPECT_EQ(left == right, areEqual) << left.description() << " and " << right.description();
        EXPECT_EQ(right == left, areEqual) << right.description() << " and " << left.description();
    }
}

TEST(ValueStorage, IsSharedByCopiesAndSeparateAfterCopyOf) {
    MutableDictionary dictionary{{"a", 1}};
    const Value value = dictionary;
    const MutableDictionary copy = MutableDictionary::copyOf(dictionary);
    dictionary.set("b", 2);
    EXPECT_EQ(value.dictionary()->size(), 2U);
    EXPECT_TRUE(value.dictionary()->sharesStorageWith(dictionary));
    EXPECT_EQ(copy, (Dictionary{{"a", 1}}));

    MutableArray array;
    const Array view = array;
    const Array before = MutableArray::copyOf(array);
    array.append(view.size());
    array.append(Value(dictionary));
    EXPECT_EQ(view, (Array{0, dictionary}));
    EXPECT_TRUE(before.empty());
    EXPECT_EQ(Array::of(std::vector<std::string>{"a", "b"}), (Array{"a", "b"}));
}

TEST(ValueStorage, OutlivesWhateverItWasTakenFrom) {
    // Key and value given to a change may live inside what the change lets go.
    MutableDictionary dictionary{{"key", "key"}, {"other", 1}};
    dictionary.set(*dictionary.string("key"), Array{2});
    EXPECT_EQ(dictionary, (Dictionary{{"key", Array{2}}, {"other", 1}}));
    dictionary.remove(dictionary.begin()->name());
    EXPECT_EQ(dictionary, (Dictionary{{"other", 1}}));

    Value value = Array{Array{"inside"}};
    value = (*value.array())[0];
    EXPECT_EQ(value, Value(Array{"inside"}));
    const Value& self = value;
    value = self;
    EXPECT_EQ(value, Value(Array{"inside"}));
}

TEST(ValueStorage, DeepStructuresAreComparedAndReleasedWithoutRecursion) {
    const auto build = [] {
        Value value = 1;
        for (int i = 0; i < 200'000; ++i) value = Array{value};
        return value;
    };
    EXPECT_TRUE(build() == build());
}

TEST(ValueStorage, IsSharedBetweenThreads) {
    const Value value = Dictionary{{"a", Array{"b", UUID{}}}};
    const auto work = [copy = value] {
        for (int i = 0; i < 10'000; ++i) {
            const Value again = copy;
            if (again.dictionary()->array("a")->size() != 2) ADD_FAILURE();
        }
    };
    std::thread one(work);
    std::thread other(work);
    one.join();
    other.join();
    EXPECT_EQ(value.dictionary()->size(), 1U);
}

// Around the number of keys from which on a dictionary is indexed, and far beyond.
TEST(Dictionary, KeepsOrderAndFindsEveryKeyAtAnySize) {
    for (const std::size_t size : {0U, 1U, 15U, 16U, 17U, 18U, 40U, 1000U}) {
        MutableDictionary dictionary;
        std::vector<std::string> keys;
        for (std::size_t i = 0; i < size; ++i) {
            keys.push_back(std::to_string(i * 7919 % 1000) + (i % 2 == 0 ? "" : "x"));
            dictionary.set(keys.back(), i);
        }
        dictionary.set("last", 0);
        dictionary.remove("last");
        dictionary.remove("missing");
        // Remove every third key and replace every fifth.
        std::vector<std::string> kept;
        for (std::size_t i = 0; i < size; ++i) {
            if (i % 5 == 0) dictionary.set(keys[i], "new");
            if (i % 3 == 0)
                dictionary.remove(keys[i]);
            else
                kept.push_back(keys[i]);
        }
        ASSERT_EQ(dictionary.size(), kept.size());
        for (std::size_t i = 0; i < kept.size(); ++i) EXPECT_EQ(dictionary.begin()[i].name(), kept[i]);
        for (std::size_t i = 0; i < size; ++i) {
            const Value expected = i % 3 == 0 ? Value() : i % 5 == 0 ? Value("new") : Value(i);
            EXPECT_EQ(dictionary[keys[i]], expected) << keys[i] << " of " << size;
        }
    }
}

TEST(Dictionary, MergeSetsEveryEntryAtAnySize) {
    for (const int size : {3, 16, 17, 100}) {
        MutableDictionary dictionary{{"1", "old"}, {"other", 1}};
        MutableDictionary added;
        for (int i = 0; i < size; ++i) added.set(std::to_string(i), i);
        dictionary.merge(added);
        dictionary.merge(dictionary);
        EXPECT_EQ(dictionary.size(), added.size() + 1);
        EXPECT_EQ(dictionary.begin()->name(), "1");
        for (const auto& [key, value] : added) EXPECT_EQ(dictionary[*key.string()], value);
    }
}

TEST(Dictionary, FromUniqueEntriesRefusesEqualKeysAtAnySize) {
    for (const std::size_t size : {2U, 16U, 17U, 100'000U}) {
        std::vector<Dictionary::Entry> entries;
        for (std::size_t i = 0; i < size; ++i) entries.push_back({std::to_string(i), i});
        const auto dictionary = Dictionary::fromUniqueEntries(entries);
        ASSERT_TRUE(dictionary);
        EXPECT_EQ(dictionary->uint64(std::to_string(size - 1)), size - 1);
        EXPECT_FALSE(dictionary->contains("x"));
        entries.back().key = "0";
        EXPECT_FALSE(Dictionary::fromUniqueEntries(std::move(entries)));
    }
}

TEST(Dictionary, TypedLookupsAnswerTheirOwnKindOnly) {
    const UUID uuid = *UUID::parse("0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0");
    const Dictionary dictionary{{"s", "text"}, {"n", -1}, {"u", uuid}, {"a", Array{1}}, {"s", "last one wins"}};
    EXPECT_EQ(dictionary.string("s"), "last one wins");
    EXPECT_EQ(dictionary.uint64("n"), std::nullopt);
    EXPECT_EQ(dictionary.uuid("u"), uuid);
    EXPECT_EQ(dictionary.array("a")->size(), 1U);
    EXPECT_FALSE(dictionary.string("u") || dictionary.uuid("s") || dictionary.dictionary("a") ||
                 dictionary.array("none"));
}

TEST(Description, IsOneLineThatCannotBeForged) {
    const struct {
        Value value;
        std::string text;
    } cases[] = {
        {Value(), "(null)"},
        {"plain text", "plain text"},
        {Dictionary{{"a", Array{1, true, -2.5}}, {"b", Dictionary{}}}, "{a = (1, true, -2.5); b = {}}"},
        {UUID{}, "00000000-0000-0000-0000-000000000000"},
        {Value::data("\x01\xFF"), "<2 bytes 01ff>"},
        {Value::data(std::string(17, 'a')), "<17 bytes 61616161616161616161616161616161…>"},
        {"a\nb\x1B[0m\x7F", "a\\x0ab\\x1b[0m\\x7f"},
        {"é\u0085\u2028", "é\\xc2\\x85\\xe2\\x80\\xa8"},
        {Dictionary{{"k\n", 1}}, "{k\\x0a = 1}"},
    };
    for (const auto& [value, text] : cases) EXPECT_EQ(value.description(), text);
}

TEST(Description, IsCutBetweenCharacters) {
    const std::string whole(4093, 'a');
    EXPECT_EQ(Value(whole).description(), whole);
    EXPECT_EQ(Value(whole + "bcde").description(), whole + "…");
    for (std::size_t i = 0; i < 4; ++i) {
        std::string text(i, 'a');
        for (int j = 0; j < 2000; ++j) text += "😀";
        const std::string cut = Value(text).description();
        EXPECT_LE(cut.size(), 4096U);
        EXPECT_EQ((cut.size() - i - 3) % 4, 0U);
        EXPECT_TRUE(cut.ends_with("😀…"));
    }
    EXPECT_LE(Value(Array(std::vector<Value>(100'000, "text"))).description().size(), 4096U);
    EXPECT_LE(nested(1000).description().size(), 4096U);
}

// The compact encoding.

TEST(CompactEncoding, HasTheDocumentedForm) {
    const Value value = Dictionary{{"n", 1}, {"list", Array{true, "é"}}};
    EXPECT_EQ(compact(value), "\x0B\x27\0\0\0\x02\0\0\0"
                              "\x01\0\0\0n"
                              "\x03\x01\0\0\0\0\0\0\0"
                              "\x04\0\0\0list"
                              "\x0A\x08\0\0\0\x02\0\0\0"
                              "\x02"
                              "\x07\x02\0\0\0\xC3\xA9"s);
}

TEST(CompactEncoding, RoundTripsEveryValue) {
    Trees trees(UUIDs::allowed);
    for (int i = 0; i < 500; ++i) {
        const Value value = trees.next();
        const std::string bytes = compact(value);
        const auto decoded = decodeCompact(bytes, UUIDs::allowed);
        ASSERT_TRUE(decoded) << decoded.error().text();
        EXPECT_EQ(*decoded, value);
        EXPECT_EQ(compact(*decoded), bytes); // kinds and order too
    }
    for (const Value& value :
         {Value(int64Min), Value(int64Max), Value(uint64Max), Value(infinity), Value(-0.0), Value("")})
        EXPECT_EQ(compact(*decodeCompact(compact(value), UUIDs::refused)), compact(value));
}

TEST(CompactDecoding, RefusesMalformedInput) {
    const struct {
        const char* what;
        std::string bytes;
    } cases[] = {
        {"no value at byte 0", ""},
        {"an unknown tag at byte 0", "\0"s},
        {"an unknown tag at byte 0", "\x0C"},
        {"bytes after the value at byte 1", "\x01\x01"},
        {"a small integer in unsigned form at byte 0", "\x04\xFF\xFF\xFF\xFF\xFF\xFF\xFF\x7F"},
        {"a date outside the years 1 to 9999 at byte 0", compact(Date{infinity})},
        {"a date outside the years 1 to 9999 at byte 0", compact(Date{notANumber})},
        {"a date outside the years 1 to 9999 at byte 0", compact(Date{253402300800})},
        {"a date outside the years 1 to 9999 at byte 0", compact(Date{-62135596801})},
        {"a length is larger than what is left at byte 1", "\x07\x02\0\0\0a"s},
        {"a length is larger than what is left at byte 1", "\x08\xFF\xFF\xFF\xFF"s},
        {"NUL in text at byte 6", "\x07\x03\0\0\0a\0b"s},
        {"NUL in text at byte 17", compactText("aaaaaaaaaaaa\0aaaaaaa"s)},
        {"a container's size is larger than what is left at byte 0", "\x0A\x02\0\0\0\x01\0\0\0\x01"s},
        {"a container's size is larger than its items at byte 0", "\x0A\x02\0\0\0\x01\0\0\0\x01\x01"s},
        {"a container's count is larger than its size allows at byte 0", "\x0A\x01\0\0\0\xFF\xFF\xFF\xFF\x01"s},
        {"a container's count is larger than its size allows at byte 0", "\x0B\x05\0\0\0\x02\0\0\0\0\0\0\0\x01"s},
        // The inner array reaches beyond the outer one.
        {"a container's size is larger than what is left at byte 9",
         "\x0A\x09\0\0\0\x01\0\0\0\x0A\x01\0\0\0\x01\0\0\0\x01"s},
        {"the value is cut short at byte 10", "\x0A\x02\0\0\0\x02\0\0\0\x0A\x01"s},
        {"NUL in text at byte 13", "\x0B\x06\0\0\0\x01\0\0\0\x01\0\0\0\0\x01"s},
        {"text is not UTF-8 at byte 13", "\x0B\x06\0\0\0\x01\0\0\0\x01\0\0\0\xFF\x01"s},
        {"a dictionary with equal keys at byte 0", "\x0B\x0C\0\0\0\x02\0\0\0\x01\0\0\0k\x01\x01\0\0\0k\x02"s},
        {"containers nest too deep at byte 736", compact(nested(maximumNesting + 1))},
    };
    for (const auto& [what, bytes] : cases) {
        const auto decoded = decodeCompact(bytes, UUIDs::allowed);
        ASSERT_FALSE(decoded) << what;
        EXPECT_EQ(decoded.error().domain, propertyListErrorDomain);
        EXPECT_EQ(decoded.error().text(), what);
    }
}

TEST(CompactDecoding, AcceptsWhatLiesJustWithinTheLimits) {
    for (const Value& value : {nested(maximumNesting), Value(Date{-62135596800}), Value(Date{253402300799.5}),
                               Value(uint64Max / 2 + 1), Value(Dictionary{{"", 1}})})
        EXPECT_TRUE(decodeCompact(compact(value), UUIDs::refused));
    const std::string uuid = compact(Array{UUID{}});
    EXPECT_TRUE(decodeCompact(uuid, UUIDs::allowed));
    EXPECT_FALSE(decodeCompact(uuid, UUIDs::refused));
    EXPECT_FALSE(decodePropertyList(std::string(compactMagic) + uuid));
}

TEST(CompactDecoding, ChecksUTF8AtEveryOffset) {
    const struct {
        std::string text;
        bool isGood;
    } cases[] = {
        {"\x7F", true},
        {"\xC2\x80", true},
        {"\xDF\xBF", true},
        {"\xE0\xA0\x80", true},
        {"\xED\x9F\xBF", true},
        {"\xEE\x80\x80", true},
        {"\xEF\xBF\xBF", true},
        {"\xF0\x90\x80\x80", true},
        {"\xF4\x8F\xBF\xBF", true},
        {"\x80", false},
        {"\xC0\x80", false},
        {"\xC1\xBF", false},
        {"\xC2", false},
        {"\xC2\x41", false},
        {"\xE0\x9F\xBF", false},
        {"\xE1\x80", false},
        {"\xE1\x80\x41", false},
        {"\xED\xA0\x80", false},
        {"\xF0\x8F\xBF\xBF", false},
        {"\xF4\x90\x80\x80", false},
        {"\xF5\x80\x80\x80", false},
        {"\xF1\x80\x80", false},
        {"\xFF", false},
        {"\xF1\x80\x80\x41", false},
    };
    // Eight bytes are looked at together, so each case stands at each place of such a group.
    for (const auto& [text, isGood] : cases)
        for (std::size_t before = 0; before < 9; ++before)
            for (const std::size_t after : {0U, 1U, 9U})
                EXPECT_EQ(bool(decodeCompact(compactText(std::string(before, 'a') + text + std::string(after, 'z')),
                                             UUIDs::refused)),
                          isGood)
                    << testing::PrintToString(text);
}

/// A value with every kind in it.
Value sample() {
    return Dictionary{{"bool", true},
                      {"int", -5},
                      {"large", uint64Max},
                      {"real", 0.1},
                      {"date", Date{1795381200.25}},
                      {"text", "Zembra é…😀 & <more>"},
                      {"data", Value::data("\0\1\2\xFF"s)},
                      {"list", Array{Array{}, Dictionary{}, Dictionary{{"deep", "er"}}}}};
}

// Every shortened form is refused; a flipped bit gives an error or a value that can be written again, never a crash.
TEST(Decoding, SurvivesTruncationAndBitFlips) {
    const std::string files[] = {std::string(compactMagic) + compact(sample()), *encodeXML(sample())};
    for (const auto& file : files) {
        ASSERT_TRUE(decodePropertyList(file));
        const std::size_t closed = file.find_last_not_of('\n') + 1; // without its last newline XML is whole
        for (std::size_t length = 0; length < closed; ++length)
            EXPECT_FALSE(decodePropertyList(file.substr(0, length))) << length;
        for (std::size_t i = 0; i < file.size() * 8; ++i) {
            std::string flipped = file;
            flipped[i / 8] = static_cast<char>(flipped[i / 8] ^ (1 << (i % 8)));
            const auto decoded = decodePropertyList(flipped);
            if (decoded) {
                EXPECT_EQ(compact(*decodeCompact(compact(*decoded), UUIDs::refused)), compact(*decoded)) << i;
            } else {
                EXPECT_EQ(decoded.error().domain, propertyListErrorDomain);
            }
        }
    }
}

// XML.

TEST(XMLEncoding, IsReadableAndDeterministic) {
    EXPECT_EQ(*encodeXML(Dictionary{{"version", 16}, {"a & b", Array{true, Dictionary{}, "x\r\ny"}}}),
              "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
              "<vlist version=\"1.0\">\n"
              "<dict>\n"
              "\t<key>version</key>\n"
              "\t<integer>16</integer>\n"
              "\t<key>a &amp; b</key>\n"
              "\t<array>\n"
              "\t\t<true/>\n"
              "\t\t<dict/>\n"
              "\t\t<string>x&#13;\ny</string>\n"
              "\t</array>\n"
              "</dict>\n"
              "</vlist>\n");
}

TEST(XMLEncoding, RoundTripsEveryValue) {
    Trees trees(UUIDs::refused);
    const auto expectSame = [](const Value& value) {
        const auto file = encodeXML(value);
        ASSERT_TRUE(file) << file.error().text();
        const auto decoded = decodePropertyList(*file);
        ASSERT_TRUE(decoded) << decoded.error().text() << *file;
        EXPECT_EQ(compact(*decoded), compact(value)) << *file; // kinds, order and every bit
    };
    for (int i = 0; i < 300; ++i) expectSame(trees.next());
    for (const double number : {0.0, -0.0, 0.1, 1e300, 5e-324, infinity, -infinity, notANumber}) expectSame(number);
    for (const double moment : {0.0, 0.1, -0.1, -0.25, -1.0, -1.5, 5e-324, -5e-324, 1795381200.123456, -62135596800.0,
                                -62135596799.5, 253402300799.99997, -86400.0, 951782400.0})
        expectSame(Date{moment});
    for (std::size_t size = 0; size < 7; ++size) expectSame(Value::data(std::string(size, '\xFE')));
    expectSame(sample());
    expectSame(nested(maximumNesting));
}

TEST(XMLEncoding, RefusesWhatXMLCannotHold) {
    const struct {
        Value value;
        const char* problem;
    } cases[] = {
        {Value(), "cannot be written as XML: an absent value"},
        {Dictionary{{"a\nb", Array{1, UUID{}}}}, "cannot be written as XML: a UUID at /a\\x0ab/1"},
        {"\x01", "cannot be written as XML: a control character"},
        {Dictionary{{"\x1F", 1}}, "cannot be written as XML: a control character at /\\x1f"},
        {"\uFFFE", "cannot be written as XML: a noncharacter"},
        {Date{253402300800}, "cannot be written as XML: a date outside the years 1 to 9999"},
        {Date{notANumber}, "cannot be written as XML: a date outside the years 1 to 9999"},
    };
    for (const auto& [value, problem] : cases) {
        const auto file = encodeXML(value);
        ASSERT_FALSE(file) << problem;
        EXPECT_EQ(file.error().text(), problem);
    }
    EXPECT_FALSE(encodeXML(nested(maximumNesting + 1)));
}

TEST(XMLDecoding, ReadsEveryForm) {
    const struct {
        std::string content;
        Value value;
    } cases[] = {
        {"<true/>", true},
        {"<false></false>", false},
        {"<integer> -9223372036854775808\n</integer>", int64Min},
        {"<integer>18446744073709551615</integer>", uint64Max},
        {"<real>1e3</real>", 1000.0},
        {"<real>-inf</real>", -infinity},
        {"<date>2026-11-22T21:00:00Z</date>", Date{1795381200}},
        {"<date>1969-12-31T23:59:59.5Z</date>", Date{-0.5}},
        {"<date>2024-02-29T00:00:00.000Z</date>", Date{1709164800}},
        {"<data>\n\tAAEC\n\t/w==\n</data>", Value::data("\0\1\2\xFF"s)},
        {"<string> a&amp;b<!-- c --><![CDATA[<&]]>&#233;\r\n</string>", " a&b<&é\n"},
        {"<string/>", ""},
        {" <!-- c --> <array> <true/> </array>", Array{true}},
        {"<dict><key/><dict/><key>k</key><array/></dict>", Dictionary{{"", Dictionary{}}, {"k", Array{}}}},
    };
    for (const auto& [content, value] : cases) {
        const auto decoded = decodePropertyList(xml(content));
        ASSERT_TRUE(decoded) << content << ": " << decoded.error().text();
        EXPECT_EQ(decoded->kind(), value.kind()) << content;
        EXPECT_EQ(*decoded, value) << content;
    }
    EXPECT_TRUE(
        decodePropertyList("\xEF\xBB\xBF<?xml version='1.0' encoding='utf-8'?><vlist version='1.0'><true/></vlist>\n"));
}

TEST(XMLDecoding, RefusesMalformedContent) {
    const std::string cases[] = {"",
                                 "<true/><false/>",
                                 "text",
                                 "<true/>text",
                                 "<key>k</key>",
                                 "<thing/>",
                                 "<True/>",
                                 "<true a='b'/>",
                                 "<true>text</true>",
                                 "<vlist><true/></vlist>",
                                 "<string>a<string/></string>",
                                 "<array>text</array>",
                                 "<array><key>k</key></array>",
                                 "<dict><true/></dict>",
                                 "<dict><key>k</key></dict>",
                                 "<dict><key>k</key><key>l</key><true/></dict>",
                                 "<dict><key>k</key><true/><false/></dict>",
                                 "<dict><key>k</key><true/>text</dict>",
                                 "<dict><key>k</key><true/><key>k</key><true/></dict>",
                                 "<dict><key>k<true/></key><true/></dict>",
                                 "<integer/>",
                                 "<integer>+1</integer>",
                                 "<integer>1 2</integer>",
                                 "<integer>0x10</integer>",
                                 "<integer>1.0</integer>",
                                 "<integer>18446744073709551616</integer>",
                                 "<integer>-9223372036854775809</integer>",
                                 "<real>1e400</real>",
                                 "<real>1,5</real>",
                                 "<real/>",
                                 "<date>2026-11-22</date>",
                                 "<date>2026-11-22T21:00:00</date>",
                                 "<date>2026-11-22 21:00:00Z</date>",
                                 "<date>2026-13-22T21:00:00Z</date>",
                                 "<date>2026-02-29T21:00:00Z</date>",
                                 "<date>2026-11-22T24:00:00Z</date>",
                                 "<date>2026-11-22T21:60:00Z</date>",
                                 "<date>2026-11-22T21:00:60Z</date>",
                                 "<date>2026-11-22T21:00:00.Z</date>",
                                 "<date>2026-11-22T21:00:00.1e2Z</date>",
                                 "<date>0000-11-22T21:00:00Z</date>",
                                 "<data>AAE</data>",
                                 "<data>AA==AAEC</data>",
                                 "<data>A===</data>",
                                 "<data>====</data>",
                                 "<data>AB==</data>",
                                 "<data>AA*=</data>",
                                 "<string>&unknown;</string>",
                                 "<string>&#0;</string>",
                                 "<string>&#1;</string>",
                                 "<string>\x01</string>",
                                 "<string>\0</string>"s,
                                 "<string>\xFF</string>",
                                 "<string>\xC0\x80</string>",
                                 "<string>\xED\xA0\x80</string>",
                                 "<string>"};
    for (const auto& content : cases) {
        const auto decoded = decodePropertyList(xml(content));
        EXPECT_FALSE(decoded) << content;
        if (decoded) continue;
        EXPECT_NE(decoded.error().text().find(" in line 1"), std::string::npos) << decoded.error().text();
    }
    EXPECT_EQ(decodePropertyList("<vlist>\n<array>\n<thing/></array></vlist>").error().text(),
              "an unknown element in line 3");
}

TEST(XMLDecoding, RefusesMalformedDocuments) {
    const std::string good = xml("<true/>");
    const std::string cases[] = {"",
                                 "true",
                                 "<dict/>",
                                 "<array><true/></array>",
                                 "<vlist other='1'><true/></vlist>",
                                 good + good,
                                 good + "text",
                                 good + "\0"s,
                                 "\0"s + good,
                                 "<!DOCTYPE vlist>" + good,
                                 "<!DOCTYPE vlist SYSTEM 'file:///etc/passwd'>" + good,
                                 "<!DOCTYPE vlist [<!ENTITY a 'b'>]>" + xml("<string>&a;</string>"),
                                 "<?xml version='1.0' encoding='ISO-8859-1'?>" + good,
                                 "<?xml version='1.0' encoding='UTF-16'?>" + good,
                                 "\xFE\xFF\0<"s,
                                 "vlist15\n\x01",
                                 "vlist16\n",
                                 "vlist16\n\x02\x02"};
    for (const auto& file : cases) EXPECT_FALSE(decodePropertyList(file)) << file;
}

TEST(XMLDecoding, BoundsNesting) {
    const auto nestedXML = [](std::size_t depth) {
        std::string open, close;
        for (std::size_t i = 0; i < depth; ++i) {
            open += i % 2 == 0 ? "<array>" : "<dict><key>k</key>";
            close += (depth - i) % 2 == 1 ? "</array>" : "</dict>";
        }
        return xml(open + (depth % 2 == 0 ? "<true/>" : "") + close);
    };
    EXPECT_TRUE(decodePropertyList(nestedXML(maximumNesting)));
    EXPECT_FALSE(decodePropertyList(nestedXML(maximumNesting + 1)));
    EXPECT_FALSE(decodePropertyList(nestedXML(100'000)));
    // What was closed counts no more.
    std::string many;
    for (std::size_t i = 0; i < 2 * maximumNesting; ++i) many += "<array/>";
    EXPECT_TRUE(decodePropertyList(xml("<array>" + many + "</array>")));
}

TEST(Decoding, KeepsTheNestingThatIsAskedFor) {
    for (const std::size_t nesting : {std::size_t{0}, std::size_t{1}, maximumManifestNesting}) {
        const auto decodes = [&](std::size_t depth) {
            const std::string bytes = compact(nested(depth));
            const bool result = bool(decodeCompact(bytes, UUIDs::refused, nesting));
            EXPECT_EQ(bool(decodePropertyList(std::string(compactMagic) + bytes, nesting)), result) << depth;
            EXPECT_EQ(bool(decodePropertyList(*encodeXML(nested(depth)), nesting)), result) << depth;
            return result;
        };
        EXPECT_TRUE(decodes(nesting)) << nesting;
        EXPECT_FALSE(decodes(nesting + 1)) << nesting;
    }
}

TEST(ValueStrings, IllFormedBytesBecomeReplacementCharacters) {
    for (const auto& [bytes, expected] : {std::pair<std::string, std::string>{"caf\xE9.app", "caf\xEF\xBF\xBD.app"},
                                          {std::string("a\0b", 3), "a\xEF\xBF\xBD"
                                                                   "b"},
                                          {"\xC3\xA9\xED\xA0\x80", "\xC3\xA9\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD"}}) {
        EXPECT_EQ(Value(bytes).string(), expected);
        std::string encoded;
        appendCompact(encoded, Value(bytes));
        EXPECT_TRUE(decodeCompact(encoded, UUIDs::refused));
    }
}

} // namespace
