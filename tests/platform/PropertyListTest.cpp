#include "platform/PropertyList.h"

#include <gtest/gtest.h>

#include <cmath>
#include <sstream>

namespace {

using namespace platform;
using namespace std::string_literals;

std::string compact(const Value& value) { return std::string(*compactData(value).data()); }

std::string xml(const std::string& content) { return "<vlist>" + content + "</vlist>"; }

std::string repeated(const std::string& text, std::size_t count) {
    std::string result;
    while (count-- > 0) result += text;
    return result;
}

/// What the error says; nothing when there is none.
template <class T> std::string problem(const Result<T>& result) { return result ? "" : result.error().text(); }

/// Arrays and dictionaries in one another, `depth` of them.
Value nested(std::size_t depth) {
    Value value = true;
    for (std::size_t i = 0; i < depth; ++i) value = i % 2 == 0 ? Value(Array{value}) : Value(Dictionary{{"k", value}});
    return value;
}

/// A value with every kind in it that a file may hold, and text that needs care as key and value.
Dictionary sample() {
    MutableDictionary sample{{"list", Array{true, -5, UINT64_MAX, 0.1, Date{1795381200.25}, Array{}, false,
                                            Value::data("\0\1\2\xFF"s), Dictionary{}, Dictionary{{"deep", "er"}}}}};
    for (const char* text : {"", "é…😀", "&<>\"'", "\r", "\n\t", " ", "]]>", "\x7F"}) sample.set(text, text);
    return sample;
}

// Values and handles.

TEST(Value, AnswersItsOwnKindAndRangeOnly) {
    EXPECT_TRUE(Value(7).uint64() == 7U && Value(7U).int64() == 7 && Value(UINT64_MAX).uint64() == UINT64_MAX);
    EXPECT_FALSE(Value(-7).uint64() || Value(UINT64_MAX).int64() || Value(true).int64() || Value(1).boolean());
    EXPECT_FALSE(Value(1).real() || Value("text").data() || Value::data("text").string() || Value());
    // Bytes that are no text become replacement characters.
    EXPECT_EQ(Value("\xC3\xA9\xED\xA0\x80.a\0b\xE9"s).string(), "é\uFFFD\uFFFD\uFFFD.a\uFFFDb\uFFFD");
}

TEST(Value, ReadsAnyNumberAsIntegerAndBoolean) {
    const std::vector<Value> values{true, -3, UINT64_MAX, -2.9, 0.5, -0.0, -1e300, 0x1p63, NAN, "1", Date{1}};
    const std::vector<std::optional<std::int64_t>> integers{1, -3, -1, -2, 0, 0, INT64_MIN, INT64_MAX, 0, {}, {}};
    const std::vector<std::optional<bool>> booleans{true, true, true, true, true, false, true, true, true, {}, {}};
    for (std::size_t i = 0; i < values.size(); ++i)
        EXPECT_TRUE(values[i].integerValue() == integers[i] && values[i].booleanValue() == booleans[i]) << i;
}

TEST(ValueEquality, NumbersCompareByExactValue) {
    // The values of a group equal one another and none of another group.
    const std::vector<Array> groups{
        // Neighbours, as far as a double can tell them apart or not.
        Array{0, -0.0, false}, Array{1, 1.0, true}, Array{1.5}, Array{-1}, Array{(1LL << 53) + 1}, Array{0x1p53},
        Array{INT64_MAX}, Array{1ULL << 63U, 0x1p63}, Array{INT64_MIN, -0x1p63}, Array{UINT64_MAX}, Array{0x1p64},
        // Kinds that look alike.
        Array{"1"}, Array{"a"}, Array{Value::data("a")}, Array{Date{1}}, Array{Date{1.5}}, Array{Array{}},
        Array{Array{1, "a"}, Array{true, "a"}}, Array{Array{"a", 1}}, Array{Dictionary{}}, Array{Dictionary{{"a", 1}}},
        Array{Dictionary{{"a", 2}}}, Array{Dictionary{{"b", 1}}},
        Array{Dictionary{{"a", 1}, {"b", 1}}, Dictionary{{"b", 1.0}, {"a", true}}}};
    for (const Array& group : groups)
        for (const Value& left : group)
            for (const Array& other : groups)
                for (const Value& right : other)
                    EXPECT_EQ(left == right, &group == &other) << left.description() << " and " << right.description();
    EXPECT_FALSE(Value(NAN) == Value(NAN) || Value(NAN) == Value(0) || Value() == Value(0) || Value("a") == Value());
    EXPECT_TRUE(Value() == Value() && nested(200'000) == nested(200'000)) << "neither comparing nor releasing recurses";
}

TEST(ValueStorage, IsSharedAndOutlivesWhatItWasTakenFrom) {
    // Key and value given to a change may live inside what the change lets go.
    MutableDictionary dictionary{{"key", "key"}, {"other", 1}};
    const Value shared = dictionary;
    dictionary.set(*dictionary.string("key"), Array{2});
    EXPECT_EQ(shared, Value(Dictionary{{"key", Array{2}}, {"other", 1}}));
}

// Around the number of keys from which on a dictionary is indexed, and far beyond; an extension is like a copy.
TEST(Dictionary, KeepsOrderAndFindsEveryKeyAtAnySize) {
    using Entries = std::vector<Dictionary::Entry>;
    const auto expect = [](const Dictionary& dictionary, const Entries& entries) {
        const Dictionary expected = *Dictionary::fromUniqueEntries(entries);
        EXPECT_TRUE(expected == dictionary && dictionary == expected);
        for (const Dictionary& each : {dictionary, dictionary.keepingEncoding()})
            EXPECT_EQ(compact(each), compact(expected)); // the order too
    };
    for (const std::size_t size : {2U, 32U, 33U, 66U, 1000U})
        for (const bool isExtension : {false, true}) {
            SCOPED_TRACE(std::to_string(size) + (isExtension ? " extending" : " copied"));
            Entries all, half, kept, removed;
            for (std::size_t i = 0; i < size; ++i) {
                const std::string key = std::to_string(i * 7919 % 1000) + (i % 2 == 0 ? "" : "x");
                all.push_back({key, i});
                if (i < size / 2) half.push_back({key, i});
                (i % 3 == 0 ? removed : kept).push_back({key, "new"});
            }
            const Dictionary base = Dictionary::fromUniqueEntries(half)->keepingEncoding();
            auto dictionary = isExtension ? MutableDictionary::extending(base) : MutableDictionary::copyOf(base);
            for (const auto& entry : all) dictionary.set(entry.key, entry.value);
            expect(dictionary, all);
            for (const auto& entry : kept) dictionary.set(entry.name(), entry.value);
            for (const auto& entry : removed) dictionary.remove(entry.name());
            expect(dictionary, kept);
            EXPECT_FALSE(dictionary.contains(removed[0].name()));
            for (auto& entry : kept) entry.value = "newer";
            kept.insert(kept.end(), removed.begin(), removed.end());
            dictionary.merge(*Dictionary::fromUniqueEntries(kept));
            expect(dictionary, kept);
            expect(base, half);
            kept.back().key = kept.front().key;
            EXPECT_FALSE(Dictionary::fromUniqueEntries(std::move(kept)));
        }
}

TEST(Value, KnowsWhetherATextBeginsWithIt) {
    for (const std::size_t length : {0U, 1U, 2U, 255U, 256U, 257U, 600U}) {
        const std::string text = std::string(length, 'a') + "b";
        EXPECT_TRUE(Value(text).isBeginningOf(text) && Value(text.substr(0, length)).isBeginningOf(text)) << length;
        EXPECT_FALSE(Value(text + "b").isBeginningOf(text) || Value(text.substr(0, length) + "c").isBeginningOf(text));
        EXPECT_FALSE(length > 2 && Value("ac" + text.substr(2)).isBeginningOf(text)) << length;
    }
    EXPECT_FALSE(Value().isBeginningOf("") || Value(1).isBeginningOf("1"));
}

TEST(Description, IsOneShortLineThatCannotBeForged) {
    const std::pair<Value, std::string> cases[] = {
        {Dictionary{{"a", Array{1, true, -2.5, UUID{}}}, {"b\n", Dictionary{}}},
         "{a = (1, true, -2.5, 00000000-0000-0000-0000-000000000000); b\\x0a = {}}"},
        {Value::data(std::string(17, 'a')), "<17 bytes 61616161616161616161616161616161…>"},
        {"a\nb\x1B[0m\x7F é\u0085\u2028", "a\\x0ab\\x1b[0m\\x7f é\\xc2\\x85\\xe2\\x80\\xa8"}};
    for (const auto& [value, text] : cases) EXPECT_EQ(value.description(), text);
    // Wherever a byte stands, for plain text is taken in pieces; and wherever the limit falls, a character stays whole.
    for (std::size_t place = 0; place <= 17; ++place) {
        const std::string before(place, 'a');
        const std::string behind(17 - place, 'b');
        for (const auto& [byte, text] : {std::pair("\x1F", "\\x1f"), {" ", " "}, {"~", "~"}, {"\x7F", "\\x7f"}})
            EXPECT_EQ(Value(before + byte + behind).description(), before + text + behind);
        const std::string cut = Value(before + repeated("😀", 2000)).description();
        EXPECT_TRUE(cut.size() <= 4096 && (cut.size() - place - 3) % 4 == 0 && cut.ends_with("😀…")) << cut;
    }
}

// The encodings.

TEST(Encoding, RoundTripsEveryValue) {
    std::vector<Value> values{INT64_MIN, sample(), nested(maximumNesting), -0.0, 1e300, 5e-324, -INFINITY, NAN};
    for (const double moment : {0.1, -0.1, -5e-324, 1795381200.123456, -62135596799.5, 253402300799.99997})
        values.emplace_back(Date{moment});
    for (std::size_t size = 0; size < 7; ++size) values.push_back(Value::data(std::string(size, '\xFE')));
    values.emplace_back(Array{compactData(sample()), 1});
    EXPECT_EQ(compactData(sample()), Value::data(compact(sample())));
    for (const Value& value : values) {
        std::string file(compactMagic);
        appendCompact(file, value);
        for (const std::string& each : {file, *encodeXML(value)}) {
            const auto decoded = decodePropertyList(each);
            ASSERT_TRUE(decoded) << problem(decoded) << each;
            EXPECT_EQ(compact(*decoded), compact(value)) << each; // kinds, order and every bit
        }
    }
    const UUID uuid = UUID::random();
    const std::string message = compact(uuid);
    EXPECT_EQ(*decodeCompact(message, UUIDs::allowed), Value(uuid));
    EXPECT_FALSE(decodeCompact(message, UUIDs::refused) || decodePropertyList(std::string(compactMagic) + message));
    EXPECT_EQ(*encodeXML(Dictionary{{"a & b", Array{true, Dictionary{}, "x\r\ny"}}}),
              "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<vlist version=\"1.0\">\n<dict>\n\t<key>a &amp; b</key>\n"
              "\t<array>\n\t\t<true/>\n\t\t<dict/>\n\t\t<string>x&#13;\ny</string>\n\t</array>\n</dict>\n</vlist>\n");
}

TEST(Encoding, RefusesWhatXMLCannotHold) {
    const std::pair<Value, std::string> cases[] = {
        {Dictionary{{"a\nb", Array{1, UUID{}}}}, "a UUID at /a\\x0ab/1"},
        {Dictionary{{"\x1F", 1}}, "a control character at /\\x1f"},
        {Date{253402300800}, "a date outside the years 1 to 9999"},
        {nested(maximumNesting + 1), "containers nested too deep at " + repeated("/0/k", 32)}};
    for (const auto& [value, what] : cases) EXPECT_EQ(problem(encodeXML(value)), "cannot be written as XML: " + what);
}

TEST(CompactDecoding, RefusesMalformedInput) {
    const std::pair<const char*, std::string> cases[] = {
        {"no value at byte 0", ""},
        {"an unknown tag at byte 0", "\x0C"},
        {"bytes after the value at byte 1", "\x01\x01"},
        {"a small integer in unsigned form at byte 0", "\x04\xFF\xFF\xFF\xFF\xFF\xFF\xFF\x7F"},
        {"a date outside the years 1 to 9999 at byte 0", compact(Date{NAN})},
        {"NUL in text at byte 6", "\x07\x03\0\0\0a\0b"s},
        {"a container's size is larger than its items at byte 0", "\x0A\x02\0\0\0\x01\0\0\0\x01\x01"s},
        {"a container's count is larger than its size allows at byte 0", "\x0A\x01\0\0\0\xFF\xFF\xFF\xFF\x01"s},
        {"a container's count is larger than its size allows at byte 0", "\x0B\x05\0\0\0\x02\0\0\0\0\0\0\0\x01"s},
        // Each array alone could hold as many items as it claims, but not all three together.
        {"a container's count is larger than its size allows at byte 18",
         "\x0A\x13\0\0\0\x12\0\0\0\x0A\x0A\0\0\0\x0A\0\0\0\x0A\x01\0\0\0\x01\0\0\0\x01"s},
        // The inner array reaches beyond the outer one.
        {"a container's size is larger than what is left at byte 9",
         "\x0A\x09\0\0\0\x01\0\0\0\x0A\x01\0\0\0\x01\0\0\0\x01"s},
        {"text is not UTF-8 at byte 13", "\x0B\x06\0\0\0\x01\0\0\0\x01\0\0\0\xFF\x01"s},
        {"a dictionary with equal keys at byte 0", "\x0B\x0C\0\0\0\x02\0\0\0\x01\0\0\0k\x01\x01\0\0\0k\x02"s}};
    for (const auto& [what, bytes] : cases) EXPECT_EQ(problem(decodeCompact(bytes, UUIDs::allowed)), what);
}

TEST(CompactDecoding, ChecksUTF8AtEveryOffset) {
    std::istringstream good(
        "\x7F \xC2\x80 \xDF\xBF \xE0\xA0\x80 \xED\x9F\xBF \xEF\xBF\xBF \xF0\x90\x80\x80 \xF4\x8F\xBF\xBF");
    std::istringstream bad("\x80 \xC0\x80 \xC1\xBF \xC2 \xC2\x41 \xE0\x9F\xBF \xE1\x80\x41 \xED\xA0\x80 \xE1\x80 "
                           "\xF0\x8F\xBF\xBF \xF4\x90\x80\x80 \xF5\x80\x80\x80 \xFF \xF1\x80\x80 \xF1\x80\x80\x41");
    // Eight bytes are looked at together, so each case stands at each place of such a group.
    for (auto* texts : {&good, &bad})
        for (std::string text; *texts >> text;)
            for (std::size_t before = 0; before < 9; ++before)
                for (const std::size_t after : {0U, 9U}) {
                    const std::string whole = std::string(before, 'a') + text + std::string(after, 'z');
                    const auto size = static_cast<char>(whole.size());
                    const auto decoded = decodeCompact("\x07"s + size + "\0\0\0"s + whole, UUIDs::refused);
                    EXPECT_EQ(bool(decoded), texts == &good) << before << " " << whole;
                }
}

TEST(Decoding, RefusesEveryTruncation) {
    for (const auto& file : {std::string(compactMagic) + compact(sample()), *encodeXML(sample())})
        // Without its last newline XML is whole.
        for (std::size_t length = file.find_last_not_of('\n') + 1; length-- > 0;)
            EXPECT_FALSE(decodePropertyList(file.substr(0, length))) << length;
}

TEST(Decoding, BoundsNesting) {
    for (const std::size_t nesting : {std::size_t{0}, std::size_t{1}, maximumNesting})
        for (const std::size_t depth : {nesting, nesting + 1}) {
            std::string text = "<true/>";
            for (std::size_t i = 0; i < depth; ++i)
                text = i % 2 == 0 ? "<array>" + text + "</array>" : "<dict><key>k</key>" + text + "</dict>";
            for (const std::string& file : {std::string(compactMagic) + compact(nested(depth)), xml(text)})
                EXPECT_EQ(bool(decodePropertyList(file, nesting)), depth == nesting) << nesting << file;
        }
    // What was closed counts no more.
    EXPECT_TRUE(decodePropertyList(xml("<array>" + repeated("<array/>", 2 * maximumNesting) + "</array>")));
}

TEST(XMLDecoding, ReadsEveryForm) {
    const std::pair<std::string, Value> cases[] = {
        {"<integer> 18446744073709551615\n</integer>", UINT64_MAX},
        {"<date>1969-12-31T23:59:59.5Z</date>", Date{-0.5}},
        {"<date>2024-02-29T00:00:00.000Z</date>", Date{1709164800}},
        {"<data>\n\tAAEC\n\t/w==\n</data>", Value::data("\0\1\2\xFF"s)},
        {"<string> a&amp;b<!-- c --><![CDATA[<&]]>&#233;\r\n</string>", " a&b<&é\n"},
        {" <!-- c --> <array> <true/> <string/> </array>", Array{true, ""}},
        {"<dict><key/><dict/><key>k</key><array/></dict>", Dictionary{{"", Dictionary{}}, {"k", Array{}}}}};
    const std::string mark = "\xEF\xBB\xBF<?xml version='1.0' encoding='utf-8'?>";
    for (const auto& [content, value] : cases) {
        const auto decoded = decodePropertyList(mark + "<vlist version='1.0'>" + content + "</vlist>\n");
        ASSERT_TRUE(decoded && decodePropertyList(xml(content))) << content << ": " << problem(decoded);
        EXPECT_EQ(compact(*decoded), compact(value)) << content;
    }
}

TEST(XMLDecoding, RefusesMalformedContent) {
    const std::pair<std::string, std::vector<std::string>> contents[] = {
        {"vlist", {"", "<true/><false/>", "text", "<key>k</key>", "<thing/>", "<string>", "<true a='b'/>", "<vlist/>"}},
        {"true", {"text"}},
        {"array", {"text", "<key>k</key>"}},
        {"dict",
         {"<true/>", "<key>k</key>", "<key>k</key><key>l</key><true/>", "<key>k</key><true/><key>k</key><true/>"}},
        {"dict", {"<key>k</key><true/>text", "<key>k<true/></key><true/>"}},
        {"integer", {"", "+1", "1 2", "0x10", "1.0", "18446744073709551616", "-9223372036854775809"}},
        {"real", {"", "1e400", "1,5"}},
        {"date", {"2026-11-22", "2026-11-22 21:00:00Z", "2026-13-22T21:00:00Z", "2026-02-29T21:00:00Z"}},
        {"date", {"2026-11-22T24:00:00Z", "2026-11-22T21:00:00.Z", "2026-11-22T21:00:00.1e2Z", "0000-11-22T21:00:00Z"}},
        {"data", {"AAE", "AA==AAEC", "A===", "====", "AB==", "AA*="}},
        {"string", {"a<string/>", "&unknown;", "&#0;", "\x01", "\0"s, "\xFF", "\xC0\x80", "\xED\xA0\x80"}}};
    for (const auto& [element, texts] : contents)
        for (const std::string& text : texts) {
            const std::string whole = "<" + element + ">" + text + "</" + element + ">";
            const std::string what = problem(decodePropertyList(element == "vlist" ? whole : xml(whole)));
            EXPECT_NE(what.find(" in line 1"), std::string::npos) << whole << ": " << what;
        }
    const std::string good = xml("<true/>");
    const std::vector<std::string> files{
        "", "true", "<dict/>", "\xFE\xFF\0<"s, "vlist15\n\x01", "vlist16\n", "vlist16\n\x02\x02",
        // The document around a good value.
        "<vlist other='1'><true/></vlist>", good + good, good + "text", good + "\0"s, "\0"s + good,
        "<?xml version='1.0' encoding='ISO-8859-1'?>" + good, "<?xml version='1.0' encoding='UTF-16'?>" + good,
        // Document types, which could make the reader open files and grow without bound.
        "<!DOCTYPE vlist>" + good, "<!DOCTYPE vlist SYSTEM 'file:///etc/passwd'>" + good,
        "<!DOCTYPE vlist [<!ENTITY a 'b'>]>" + xml("<string>&a;</string>"),
        xml(repeated("<array>", 100'000) + repeated("</array>", 100'000))};
    for (const auto& file : files) EXPECT_FALSE(decodePropertyList(file)) << file;
}

} // namespace
