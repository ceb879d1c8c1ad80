#include "platform/PropertyList.h"

#include <gtest/gtest.h>

#include <cmath>
#include <functional>
#include <limits>

namespace {

using namespace platform;
using namespace std::string_literals;

constexpr auto int64Max = std::numeric_limits<std::int64_t>::max();
constexpr auto int64Min = std::numeric_limits<std::int64_t>::min();
constexpr auto uint64Max = std::numeric_limits<std::uint64_t>::max();
constexpr double infinity = std::numeric_limits<double>::infinity();
constexpr double notANumber = std::numeric_limits<double>::quiet_NaN();

const UUID uuid = *UUID::parse("0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0");

std::string compact(const Value& value) {
    std::string bytes;
    appendCompact(bytes, value);
    return bytes;
}

/// The encoding of a string with these very bytes, good or bad.
std::string compactText(const std::string& text) { return "\x07"s + static_cast<char>(text.size()) + "\0\0\0"s + text; }

std::string xml(const std::string& content) { return "<vlist>" + content + "</vlist>"; }

std::string repeated(const std::string& text, std::size_t count) {
    std::string result;
    for (std::size_t i = 0; i < count; ++i) result += text;
    return result;
}

/// Arrays and dictionaries in one another, `depth` of them.
Value nested(std::size_t depth) {
    Value value = true;
    for (std::size_t i = 0; i < depth; ++i) value = i % 2 == 0 ? Value(Array{value}) : Value(Dictionary{{"k", value}});
    return value;
}

/// As many keys as take an index, and some text that needs care under each.
Dictionary manyTexts() {
    MutableDictionary dictionary;
    for (int i = 0; i < 40; ++i)
        for (const char* text : {"", "é…😀", "&<>\"'", "\r", "\n\t", " ", "]]>", "\x7F"})
            dictionary.set(text + std::to_string(i), text);
    return dictionary;
}

/// A value with every kind in it that a file may hold.
const Dictionary sample{{"bool", true},
                        {"int", -5},
                        {"large", uint64Max},
                        {"real", 0.1},
                        {"date", Date{1795381200.25}},
                        {"text", "Zembra é…😀 & <more>"},
                        {"data", Value::data("\0\1\2\xFF"s)},
                        {"list", Array{Array{}, false, Dictionary{}, Dictionary{{"deep", "er"}}}}};

// Values and handles.

TEST(Value, AnswersItsOwnKindAndRangeOnly) {
    EXPECT_EQ(Value(7).uint64(), 7U);
    EXPECT_EQ(Value(7U).int64(), 7);
    EXPECT_EQ(Value(uint64Max).uint64(), uint64Max);
    EXPECT_EQ(Value::data("a\0b"s).data(), "a\0b"s);
    EXPECT_FALSE(Value(-7).uint64() || Value(uint64Max).int64() || Value(true).int64());
    EXPECT_FALSE(Value(1).boolean() || Value(1).real() || Value("text").data() || Value::data("text").string());
    EXPECT_FALSE(Value(Dictionary()).array() || Value(Array()).dictionary() || Value());
    const Dictionary dictionary{{"s", "text"}, {"n", -1}, {"u", uuid}, {"a", Array{1}}, {"s", "last one wins"}};
    EXPECT_EQ(dictionary.string("s"), "last one wins");
    EXPECT_EQ(dictionary.uuid("u"), uuid);
    EXPECT_EQ(dictionary.array("a")->size(), 1U);
    EXPECT_FALSE(dictionary.uint64("n") || dictionary.string("u") || dictionary.uuid("s") ||
                 dictionary.dictionary("a") || dictionary.array("none"));
}

TEST(Value, ReadsAnyNumberAsIntegerAndBoolean) {
    const struct {
        Value value;
        std::optional<std::int64_t> integer;
        std::optional<bool> boolean;
    } cases[] = {
        {true, 1, true},
        {-3, -3, true},
        {uint64Max, -1, true},
        {-2.9, -2, true},
        {0.5, 0, true},
        {-0.0, 0, false},
        {-1e300, int64Min, true},
        {9223372036854775808.0, int64Max, true},
        {notANumber, 0, true},
        {"1", std::nullopt, std::nullopt},
        {Date{1}, std::nullopt, std::nullopt},
    };
    for (const auto& [value, integer, boolean] : cases) {
        EXPECT_EQ(value.integerValue(), integer) << value.description();
        EXPECT_EQ(value.booleanValue(), boolean) << value.description();
    }
}

TEST(ValueEquality, NumbersCompareByExactValue) {
    const std::pair<Value, Value> equal[] = {
        {1, true},
        {1.0, true},
        {-0.0, 0},
        {uint64Max - 2047, 18446744073709549568.0},
        {1ULL << 63U, 9223372036854775808.0},
        {int64Min, -9223372036854775808.0},
        {Array{1, "a"}, Array{true, "a"}},
        {Dictionary{{"a", 1}, {"b", 2}}, Dictionary{{"b", 2.0}, {"a", true}}},
    };
    for (const auto& [left, right] : equal)
        EXPECT_TRUE(left == right && right == left) << left.description() << " and " << right.description();
    const std::vector<Value> different{// Neighbours, as far as a double can tell them apart or not.
                                       false, 1, 1.5, 2, -1, (1LL << 53) + 1, 9007199254740992.0, int64Max,
                                       9223372036854775808.0, uint64Max, 18446744073709551616.0, infinity,
                                       // Kinds that look alike.
                                       Value(), "1", "a", Value::data("a"), Date{1}, Date{1.5}, nested(69), nested(70),
                                       Array{}, Array{1, "a"}, Array{"a", 1}, Dictionary{}, Dictionary{{"a", 1}},
                                       Dictionary{{"a", 2}}, Dictionary{{"b", 1}}, Dictionary{{"a", 1}, {"b", 1}}};
    for (const Value& left : different)
        for (const Value& right : different)
            EXPECT_EQ(left == right, &left == &right) << left.description() << " and " << right.description();
    EXPECT_FALSE(Value(notANumber) == Value(notANumber) || Value(notANumber) == Value(0));
    EXPECT_TRUE(nested(70) == nested(70));
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
    array.append(Value(dictionary));
    EXPECT_EQ(view, Array{dictionary});
    EXPECT_TRUE(before.empty());
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
}

TEST(ValueStorage, DeepStructuresAreComparedAndReleasedWithoutRecursion) {
    EXPECT_TRUE(nested(200'000) == nested(200'000));
}

TEST(ValueStrings, IllFormedBytesBecomeReplacementCharacters) {
    const std::pair<std::string, std::string> cases[] = {
        {"caf\xE9.app", "caf\uFFFD.app"}, {"a\0b"s, "a\uFFFDb"}, {"\xC3\xA9\xED\xA0\x80", "é\uFFFD\uFFFD\uFFFD"}};
    for (const auto& [bytes, expected] : cases) EXPECT_EQ(Value(bytes).string(), expected);
}

// Around the number of keys from which on a dictionary is indexed, and far beyond.
TEST(Dictionary, KeepsOrderAndFindsEveryKeyAtAnySize) {
    for (const std::size_t size : {0U, 1U, 15U, 16U, 17U, 18U, 40U, 1000U}) {
        MutableDictionary dictionary;
        const auto key = [](std::size_t i) { return std::to_string(i * 7919 % 1000) + (i % 2 == 0 ? "" : "x"); };
        for (std::size_t i = 0; i < size; ++i) dictionary.set(key(i), i);
        dictionary.remove("missing");
        std::vector<std::string> kept;
        for (std::size_t i = 0; i < size; ++i) {
            if (i % 5 == 0) dictionary.set(key(i), "new");
            if (i % 3 == 0) dictionary.remove(key(i));
            if (i % 3 != 0) kept.push_back(key(i));
        }
        ASSERT_EQ(dictionary.size(), kept.size());
        std::size_t place = 0;
        for (const auto& entry : dictionary) EXPECT_EQ(entry.name(), kept[place++]);
        for (std::size_t i = 0; i < size; ++i) {
            const Value expected = i % 3 == 0 ? Value() : i % 5 == 0 ? Value("new") : Value(i);
            EXPECT_EQ(dictionary[key(i)], expected) << key(i) << " of " << size;
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
        entries.back().key = "0";
        EXPECT_FALSE(Dictionary::fromUniqueEntries(std::move(entries)));
    }
}

TEST(DictionaryExtension, IsLikeACopyWhateverChanges) {
    const Dictionary kept = Dictionary{{"a", 1}, {"b", Array{2}}, {"c", "x"}}.keepingEncoding();
    const std::string before = compact(kept);
    const std::function<void(MutableDictionary&)> changes[] = {
        [](auto&) {},
        [](auto& it) { it.set("d", "new"); },
        [](auto& it) { it.set("b", "replaced"); },
        [](auto& it) { it.remove("a"); },
        [](auto& it) { it.remove("missing"); },
        [](auto& it) { it.merge({{"c", 3}, {"e", 4}}); },
        [](auto& it) {
            for (int i = 0; i < 40; ++i) it.set(std::to_string(i), i);
            it.remove("7");
            it.set(Value("a"), Dictionary());
        },
    };
    for (std::size_t i = 0; i < std::size(changes); ++i) {
        auto extension = MutableDictionary::extending(kept);
        auto copy = MutableDictionary::copyOf(kept);
        for (int time = 0; time < 2; ++time) {
            for (auto* each : {&extension, &copy}) changes[i](*each);
            EXPECT_EQ(extension, copy) << i;
            EXPECT_EQ(compact(extension), compact(copy)) << i; // the order too
            EXPECT_EQ(extension.size(), copy.size()) << i;
            EXPECT_EQ(Value(extension).description(), Value(copy).description()) << i;
            for (const auto& [key, value] : copy) EXPECT_EQ(extension[*key.string()], value) << i;
            extension = MutableDictionary::copyOf(extension);
        }
        EXPECT_EQ(compact(extension.keepingEncoding()), compact(copy)) << i;
    }
    EXPECT_EQ(compact(kept), before);
}

TEST(Description, IsOneLineThatCannotBeForged) {
    const std::pair<Value, std::string> cases[] = {
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
    // Wherever a byte stands, for plain text is taken in pieces.
    const std::pair<char, std::string> bytes[] = {{'\x1F', "\\x1f"}, {' ', " "}, {'~', "~"}, {'\x7F', "\\x7f"}};
    for (std::size_t place = 0; place <= 17; ++place) {
        for (const auto& [byte, text] : bytes) {
            const std::string before(place, 'a');
            const std::string behind(17 - place, 'b');
            EXPECT_EQ(Value(before + byte + behind).description(), before + text + behind);
        }
    }
}

TEST(Description, IsCutBetweenCharacters) {
    const std::string whole(4093, 'a');
    EXPECT_EQ(Value(whole).description(), whole);
    EXPECT_EQ(Value(whole + "bcde").description(), whole + "…");
    for (std::size_t i = 0; i < 4; ++i) {
        const std::string cut = Value(std::string(i, 'a') + repeated("😀", 2000)).description();
        EXPECT_LE(cut.size(), 4096U);
        EXPECT_EQ((cut.size() - i - 3) % 4, 0U);
        EXPECT_TRUE(cut.ends_with("😀…"));
    }
    EXPECT_LE(Value(Array(std::vector<Value>(100'000, "text"))).description().size(), 4096U);
    EXPECT_LE(nested(1000).description().size(), 4096U);
}

// The compact encoding.

TEST(CompactEncoding, HasTheDocumentedForm) {
    EXPECT_EQ(compact(Dictionary{{"n", 1}, {"list", Array{true, "é"}}}), "\x0B\x27\0\0\0\x02\0\0\0"
                                                                         "\x01\0\0\0n"
                                                                         "\x03\x01\0\0\0\0\0\0\0"
                                                                         "\x04\0\0\0list"
                                                                         "\x0A\x08\0\0\0\x02\0\0\0"
                                                                         "\x02"
                                                                         "\x07\x02\0\0\0\xC3\xA9"s);
}

TEST(CompactEncoding, RoundTripsEveryValue) {
    for (const Value& value : std::vector<Value>{int64Min, int64Max, infinity, -0.0, "", uuid, sample, manyTexts()}) {
        const std::string bytes = compact(value);
        const auto decoded = decodeCompact(bytes, UUIDs::allowed);
        ASSERT_TRUE(decoded) << decoded.error().text();
        EXPECT_EQ(*decoded, value);
        EXPECT_EQ(compact(*decoded), bytes); // kinds and order too
        EXPECT_EQ(platform::compactSize(value), bytes.size());
        EXPECT_EQ(platform::compactData(value).data(), bytes);
    }
}

TEST(CompactDecoding, RefusesMalformedInput) {
    const std::pair<const char*, std::string> cases[] = {
        {"no value at byte 0", ""},
        {"an unknown tag at byte 0", "\0"s},
        {"an unknown tag at byte 0", "\x0C"},
        {"bytes after the value at byte 1", "\x01\x01"},
        {"a small integer in unsigned form at byte 0", "\x04\xFF\xFF\xFF\xFF\xFF\xFF\xFF\x7F"},
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
    for (const Value& value :
         {Value(Date{-62135596800}), Value(Date{253402300799.5}), Value(uint64Max / 2 + 1), Value(Dictionary{{"", 1}})})
        EXPECT_TRUE(decodeCompact(compact(value), UUIDs::refused));
    const std::string bytes = compact(Array{uuid});
    EXPECT_FALSE(decodeCompact(bytes, UUIDs::refused));
    EXPECT_FALSE(decodePropertyList(std::string(compactMagic) + bytes));
}

TEST(CompactDecoding, ChecksUTF8AtEveryOffset) {
    const std::vector<std::string> good{"\x7F",         "\xC2\x80",         "\xDF\xBF",
                                        "\xE0\xA0\x80", "\xED\x9F\xBF",     "\xEE\x80\x80",
                                        "\xEF\xBF\xBF", "\xF0\x90\x80\x80", "\xF4\x8F\xBF\xBF"};
    const std::vector<std::string> bad{
        "\x80",         "\xC0\x80",     "\xC1\xBF",         "\xC2",     "\xC2\x41",         "\xE0\x9F\xBF",
        "\xE1\x80\x41", "\xED\xA0\x80", "\xF0\x8F\xBF\xBF", "\xE1\x80", "\xF4\x90\x80\x80", "\xF5\x80\x80\x80",
        "\xFF",         "\xF1\x80\x80", "\xF1\x80\x80\x41"};
    // Eight bytes are looked at together, so each case stands at each place of such a group.
    for (const auto* texts : {&good, &bad})
        for (const std::string& text : *texts)
            for (std::size_t before = 0; before < 9; ++before)
                for (const std::size_t after : {0U, 1U, 9U}) {
                    const auto bytes = compactText(std::string(before, 'a') + text + std::string(after, 'z'));
                    EXPECT_EQ(bool(decodeCompact(bytes, UUIDs::refused)), texts == &good) << before << " " << bytes;
                }
}

// Every shortened form is refused; a flipped bit gives an error or a value that can be written again, never a crash.
TEST(Decoding, SurvivesTruncationAndBitFlips) {
    for (const auto& file : {std::string(compactMagic) + compact(sample), *encodeXML(sample)}) {
        const std::size_t closed = file.find_last_not_of('\n') + 1; // without its last newline XML is whole
        for (std::size_t length = 0; length < closed; ++length)
            EXPECT_FALSE(decodePropertyList(file.substr(0, length))) << length;
        for (std::size_t i = 0; i < file.size() * 8; ++i) {
            std::string flipped = file;
            flipped[i / 8] = static_cast<char>(flipped[i / 8] ^ (1 << (i % 8)));
            const auto decoded = decodePropertyList(flipped);
            if (!decoded) continue;
            EXPECT_EQ(compact(*decodeCompact(compact(*decoded), UUIDs::refused)), compact(*decoded)) << i;
        }
    }
}

TEST(Decoding, BoundsNesting) {
    for (const std::size_t nesting : {std::size_t{0}, std::size_t{1}, maximumManifestNesting, maximumNesting}) {
        const auto decodes = [&](std::size_t depth) {
            const std::string bytes = compact(nested(depth));
            std::string text = "<true/>";
            for (std::size_t i = 0; i < depth; ++i)
                text = i % 2 == 0 ? "<array>" + text + "</array>" : "<dict><key>k</key>" + text + "</dict>";
            const bool result = bool(decodeCompact(bytes, UUIDs::refused, nesting));
            EXPECT_EQ(bool(decodePropertyList(std::string(compactMagic) + bytes, nesting)), result) << depth;
            EXPECT_EQ(bool(decodePropertyList(xml(text), nesting)), result) << depth;
            return result;
        };
        EXPECT_TRUE(decodes(nesting)) << nesting;
        EXPECT_FALSE(decodes(nesting + 1)) << nesting;
    }
    EXPECT_FALSE(decodePropertyList(xml(repeated("<array>", 100'000) + repeated("</array>", 100'000))));
    // What was closed counts no more.
    EXPECT_TRUE(decodePropertyList(xml("<array>" + repeated("<array/>", 2 * maximumNesting) + "</array>")));
}

// XML.

TEST(XMLEncoding, IsReadableAndDeterministic) {
    EXPECT_EQ(*encodeXML(Dictionary{{"version", 16}, {"a & b", Array{true, Dictionary{}, "x\r\ny"}}}),
              R"(<?xml version="1.0" encoding="UTF-8"?>
<vlist version="1.0">
<dict>
	<key>version</key>
	<integer>16</integer>
	<key>a &amp; b</key>
	<array>
		<true/>
		<dict/>
		<string>x&#13;
y</string>
	</array>
</dict>
</vlist>
)");
}

TEST(XMLEncoding, RoundTripsEveryValue) {
    std::vector<Value> values{int64Min, int64Max, "", sample, manyTexts(), nested(maximumNesting)};
    for (const double number : {-0.0, 0.1, 1e300, 5e-324, infinity, -infinity, notANumber}) values.emplace_back(number);
    for (const double moment : {0.0, 0.1, -0.1, -0.25, -1.0, 5e-324, -5e-324, 0x1p-60, 1795381200.123456,
                                -62135596800.0, -62135596799.5, 253402300799.99997, -86400.0, 951782400.0})
        values.emplace_back(Date{moment});
    for (std::size_t size = 0; size < 7; ++size) values.push_back(Value::data(std::string(size, '\xFE')));
    for (const Value& value : values) {
        const auto file = encodeXML(value);
        ASSERT_TRUE(file) << file.error().text();
        const auto decoded = decodePropertyList(*file);
        ASSERT_TRUE(decoded) << decoded.error().text() << *file;
        EXPECT_EQ(compact(*decoded), compact(value)) << *file; // kinds, order and every bit
    }
}

TEST(XMLEncoding, RefusesWhatXMLCannotHold) {
    const std::pair<Value, std::string> cases[] = {
        {Value(), "an absent value"},
        {Dictionary{{"a\nb", Array{1, UUID{}}}}, "a UUID at /a\\x0ab/1"},
        {"\x01", "a control character"},
        {Dictionary{{"\x1F", 1}}, "a control character at /\\x1f"},
        {"\uFFFE", "a noncharacter"},
        {Date{253402300800}, "a date outside the years 1 to 9999"},
        {Date{notANumber}, "a date outside the years 1 to 9999"},
    };
    for (const auto& [value, problem] : cases) {
        const auto file = encodeXML(value);
        ASSERT_FALSE(file) << problem;
        EXPECT_EQ(file.error().text(), "cannot be written as XML: " + problem);
    }
    EXPECT_FALSE(encodeXML(nested(maximumNesting + 1)));
}

TEST(XMLDecoding, ReadsEveryForm) {
    const std::pair<std::string, Value> cases[] = {
        {"<false></false>", false},
        {"<integer> -9223372036854775808\n</integer>", int64Min},
        {"<integer>18446744073709551615</integer>", uint64Max},
        {"<real>1e3</real>", 1000.0},
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
    const std::pair<std::string, std::vector<std::string>> contents[] = {
        {"vlist", {"", "<true/><false/>", "text", "<true/>text", "<key>k</key>", "<thing/>", "<True/>", "<string>"}},
        {"vlist", {"<true a='b'/>", "<vlist><true/></vlist>"}},
        {"true", {"text"}},
        {"array", {"text", "<key>k</key>"}},
        {"dict", {"<true/>", "<key>k</key>", "<key>k</key><key>l</key><true/>", "<key>k</key><true/><false/>"}},
        {"dict", {"<key>k</key><true/>text", "<key>k</key><true/><key>k</key><true/>", "<key>k<true/></key><true/>"}},
        {"integer", {"", "+1", "1 2", "0x10", "1.0", "18446744073709551616", "-9223372036854775809"}},
        {"real", {"", "1e400", "1,5"}},
        {"date", {"2026-11-22", "2026-11-22T21:00:00", "2026-11-22 21:00:00Z", "2026-13-22T21:00:00Z"}},
        {"date", {"2026-02-29T21:00:00Z", "2026-11-22T24:00:00Z", "2026-11-22T21:60:00Z", "2026-11-22T21:00:60Z"}},
        {"date", {"2026-11-22T21:00:00.Z", "2026-11-22T21:00:00.1e2Z", "0000-11-22T21:00:00Z"}},
        {"data", {"AAE", "AA==AAEC", "A===", "====", "AB==", "AA*="}},
        {"string", {"a<string/>", "&unknown;", "&#0;", "&#1;", "\x01", "\0"s, "\xFF", "\xC0\x80", "\xED\xA0\x80"}},
    };
    for (const auto& [element, texts] : contents)
        for (const std::string& text : texts) {
            const std::string whole = "<" + element + ">" + text + "</" + element + ">";
            const auto decoded = decodePropertyList(element == "vlist" ? whole : xml(whole));
            ASSERT_FALSE(decoded) << whole;
            EXPECT_NE(decoded.error().text().find(" in line 1"), std::string::npos) << decoded.error().text();
        }
    EXPECT_EQ(decodePropertyList("<vlist>\n<array>\n<thing/></array></vlist>").error().text(),
              "an unknown element in line 3");
}

TEST(XMLDecoding, RefusesMalformedDocuments) {
    const std::string good = xml("<true/>");
    const std::vector<std::string> cases{
        "", "true", "<dict/>", "\xFE\xFF\0<"s, "vlist15\n\x01", "vlist16\n", "vlist16\n\x02\x02",
        // The document around a good value.
        "<vlist other='1'><true/></vlist>", good + good, good + "text", good + "\0"s, "\0"s + good,
        "<?xml version='1.0' encoding='ISO-8859-1'?>" + good, "<?xml version='1.0' encoding='UTF-16'?>" + good,
        // Document types, which could make the reader open files and grow without bound.
        "<!DOCTYPE vlist>" + good, "<!DOCTYPE vlist SYSTEM 'file:///etc/passwd'>" + good,
        "<!DOCTYPE vlist [<!ENTITY a 'b'>]>" + xml("<string>&a;</string>")};
    for (const auto& file : cases) EXPECT_FALSE(decodePropertyList(file)) << file;
}

} // namespace
