#include "platform/PropertyList.h"

#include "platform/linux/PropertyListCoding.h"
#include "platform/linux/TransportMessage.h"
#include "platform/linux/Utf8.h"

#include <bit>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace platform {

namespace {

using linux_::CodingError;
using linux_::codingError;

enum Tag : std::uint8_t {
    falseTag = 0x01,
    trueTag = 0x02,
    integerTag = 0x03,
    unsignedTag = 0x04, // only for integers above the signed range, so that a number has one encoding
    realTag = 0x05,
    dateTag = 0x06,
    stringTag = 0x07,
    dataTag = 0x08,
    uuidTag = 0x09,
    arrayTag = 0x0A,
    dictionaryTag = 0x0B,
};

template <class Number> Number littleEndian(Number number) noexcept {
    if constexpr (std::endian::native == std::endian::little) return number;
    Number swapped = 0;
    for (std::size_t i = 0; i < sizeof number; ++i) {
        swapped = static_cast<Number>((swapped << 8U) | (number & 0xFFU));
        number = static_cast<Number>(number >> 8U);
    }
    return swapped;
}

/// Decoded values nest at most `maximumNesting` deep and the daemon wraps them in a few containers of its own. What
/// nests deeper than this was built by mistake, and encoding it would risk the stack.
constexpr std::size_t maximumBuiltNesting = 4 * maximumNesting;

/// Where an encoding goes. Containers begin with their size, which is patched in behind.
class StringSink {
public:
    explicit StringSink(std::string& out) : _out(out) {}
    std::size_t position() const { return _out.size(); }
    void put(const void* bytes, std::size_t size) { _out.append(static_cast<const char*>(bytes), size); }
    void patch(std::size_t position, std::uint32_t number) {
        std::memcpy(_out.data() + position, &number, sizeof number);
    }

private:
    std::string& _out;
};

class CountingSink {
public:
    std::size_t position() const { return _size; }
    void put(const void*, std::size_t size) { _size += size; }
    void patch(std::size_t, std::uint32_t) {}

private:
    std::size_t _size = 0;
};

template <class Sink> class Writer {
public:
    explicit Writer(Sink& sink) : _sink(sink) {}

    void append(const Value& value, std::size_t depth = 0) {
        switch (value.kind()) {
        case Kind::none: fail("an absent value has no encoding");
        case Kind::boolean: putTag(*value.boolean() ? trueTag : falseTag); break;
        case Kind::integer:
            if (const auto number = value.int64())
                putNumber(integerTag, static_cast<std::uint64_t>(*number));
            else
                putNumber(unsignedTag, *value.uint64());
            break;
        case Kind::real: putNumber(realTag, std::bit_cast<std::uint64_t>(*value.real())); break;
        case Kind::date: putNumber(dateTag, std::bit_cast<std::uint64_t>(value.date()->seconds)); break;
        case Kind::string: putBytes(stringTag, *value.string()); break;
        case Kind::data: {
            const Value* const content = linux_::deferredContent(value);
            if (content == nullptr) {
                putBytes(dataTag, *value.data());
                break;
            }
            const std::uint32_t size = 0;
            putTag(dataTag);
            _sink.put(&size, sizeof size);
            const std::size_t start = _sink.position();
            append(*content, depth + 1);
            _sink.patch(start - sizeof size, sizeField(_sink.position() - start));
            break;
        }
        case Kind::uuid: {
            putTag(uuidTag);
            const UUID uuid = *value.uuid();
            _sink.put(uuid.bytes.data(), uuid.bytes.size());
            break;
        }
        case Kind::array: {
            const auto items = linux_::itemsOf(value);
            const std::size_t start = beginContainer(arrayTag, items.size(), depth);
            for (const auto& item : items) append(item, depth + 1);
            endContainer(start);
            break;
        }
        case Kind::dictionary: {
            const auto parts = linux_::encodingParts(value);
            const std::size_t start = beginContainer(dictionaryTag, parts.keptEntries + parts.others.size(), depth);
            _sink.put(parts.kept.data(), parts.kept.size());
            for (const auto& entry : parts.others) appendEntry(entry, depth + 1);
            endContainer(start);
            break;
        }
        }
    }

    void appendEntry(const Dictionary::Entry& entry, std::size_t depth) {
        putSized(entry.name());
        append(entry.value, depth);
    }

private:
    [[noreturn]] static void fail(const char* text) {
        std::fprintf(stderr, "compact encoding: %s\n", text);
        std::abort();
    }

    static std::uint32_t sizeField(std::size_t size) {
        if (size > UINT32_MAX) fail("a value of 4 GiB or more");
        return littleEndian(static_cast<std::uint32_t>(size));
    }

    void putTag(Tag tag) { _sink.put(&tag, sizeof tag); }

    void putNumber(Tag tag, std::uint64_t number) {
        char bytes[1 + sizeof number];
        bytes[0] = static_cast<char>(tag);
        number = littleEndian(number);
        std::memcpy(bytes + 1, &number, sizeof number);
        _sink.put(bytes, sizeof bytes);
    }

    void putBytes(Tag tag, std::string_view bytes) {
        putTag(tag);
        putSized(bytes);
    }

    void putSized(std::string_view bytes) {
        const std::uint32_t size = sizeField(bytes.size());
        _sink.put(&size, sizeof size);
        _sink.put(bytes.data(), bytes.size());
    }

    /// Leaves room for the size; the answer says where the items begin.
    std::size_t beginContainer(Tag tag, std::size_t count, std::size_t depth) {
        if (depth == maximumBuiltNesting) fail("a value nests without end");
        const std::uint32_t fields[2] = {0, sizeField(count)};
        putTag(tag);
        _sink.put(fields, sizeof fields);
        return _sink.position();
    }

    void endContainer(std::size_t start) {
        const std::uint32_t size = sizeField(_sink.position() - start);
        _sink.patch(start - 2 * sizeof size, size);
    }

    Sink& _sink;
};

class Reader {
public:
    Reader(std::string_view bytes, std::size_t offset, UUIDs uuids, std::size_t nesting,
           std::size_t maximumMemory = SIZE_MAX)
        : _bytes(bytes),
          _at(offset),
          _end(bytes.size()),
          _uuids(uuids),
          _nesting(nesting),
          _maximumMemory(maximumMemory) {}

    Result<Value> read() {
        Value value;
        if (readValue(value, 0) && _at != _end) fail("bytes after the value", _at);
        if (_problem) return codingError(CodingError::malformed, std::move(*_problem));
        return value;
    }

    /// Bytes of memory that the value takes. Counted beside the sizes: nodes, the index of a dictionary, and what the
    /// allocator rounds up.
    std::size_t memory() const { return _memory; }

private:
    // The least that an item takes, so that a count can be refused before memory is reserved for it.
    static constexpr std::size_t smallestValue = 1;
    static constexpr std::size_t smallestEntry = sizeof(std::uint32_t) + smallestValue;

    static constexpr std::size_t leafMemory = 40;       // and the bytes
    static constexpr std::size_t containerMemory = 136; // and the items
    static constexpr std::size_t entryMemory = sizeof(Dictionary::Entry) + sizeof(std::uint32_t);

    std::size_t left() const noexcept { return _end - _at; }

    /// Always false, for a caller to pass on.
    bool fail(std::string_view what, std::size_t where) {
        _problem = std::string(what) + " at byte " + std::to_string(where);
        return false;
    }

    /// To be asked before memory is taken.
    bool takeMemory(std::size_t size, std::size_t where) {
        if (size > _maximumMemory - _memory) return fail("a value that takes too much memory", where);
        _memory += size;
        return true;
    }

    template <class Number> bool readNumber(Number& number) {
        if (left() < sizeof number) return fail("the value is cut short", _at);
        std::memcpy(&number, _bytes.data() + _at, sizeof number);
        number = littleEndian(number);
        _at += sizeof number;
        return true;
    }

    bool readBytes(std::string_view& bytes) {
        const std::size_t start = _at;
        std::uint32_t size = 0;
        if (!readNumber(size)) return false;
        if (size > left()) return fail("a length is larger than what is left", start);
        if (!takeMemory(leafMemory + size, start)) return false;
        bytes = _bytes.substr(_at, size);
        _at += size;
        return true;
    }

    bool readText(std::string_view& text) {
        if (!readBytes(text)) return false;
        if (const auto bad = linux_::firstBadByte(text))
            return fail(text[*bad] == '\0' ? "NUL in text" : "text is not UTF-8", _at - text.size() + *bad);
        return true;
    }

    bool readValue(Value& value, std::size_t depth) {
        const std::size_t start = _at;
        if (left() == 0) return fail(start == 0 ? "no value" : "the value is cut short", start);
        std::uint64_t bits = 0;
        std::string_view bytes;
        switch (static_cast<std::uint8_t>(_bytes[_at++])) {
        case falseTag: value = false; return true;
        case trueTag: value = true; return true;
        case integerTag:
            if (!readNumber(bits)) return false;
            value = static_cast<std::int64_t>(bits);
            return true;
        case unsignedTag:
            if (!readNumber(bits)) return false;
            if (bits <= static_cast<std::uint64_t>(INT64_MAX)) return fail("a small integer in unsigned form", start);
            value = bits;
            return true;
        case realTag:
            if (!readNumber(bits)) return false;
            value = std::bit_cast<double>(bits);
            return true;
        case dateTag: {
            if (!readNumber(bits)) return false;
            const Date date{std::bit_cast<double>(bits)};
            if (!linux_::isEncodableDate(date)) return fail("a date outside the years 1 to 9999", start);
            value = date;
            return true;
        }
        case stringTag:
            if (!readText(bytes)) return false;
            value = bytes;
            return true;
        case dataTag:
            if (!readBytes(bytes)) return false;
            value = Value::data(bytes);
            return true;
        case uuidTag: return readUUID(value, start);
        case arrayTag:
            return readContainer(smallestValue, sizeof(Value), start, depth,
                                 [&](std::uint32_t count) { return readItems(value, count, depth); });
        case dictionaryTag:
            return readContainer(smallestEntry, entryMemory, start, depth,
                                 [&](std::uint32_t count) { return readEntries(value, count, start, depth); });
        default: return fail("an unknown tag", start);
        }
    }

    bool readUUID(Value& value, std::size_t start) {
        if (_uuids == UUIDs::refused) return fail("a UUID where none may be", start);
        UUID uuid;
        if (left() < uuid.bytes.size()) return fail("the value is cut short", _at);
        if (!takeMemory(leafMemory, start)) return false;
        std::memcpy(uuid.bytes.data(), _bytes.data() + _at, uuid.bytes.size());
        _at += uuid.bytes.size();
        value = uuid;
        return true;
    }

    /// Reads size and count, and holds `readContent` to exactly that size.
    template <class Content>
    bool readContainer(std::size_t smallestItem, std::size_t itemMemory, std::size_t start, std::size_t depth,
                       Content readContent) {
        if (depth == _nesting) return fail("containers nest too deep", start);
        std::uint32_t size = 0;
        std::uint32_t count = 0;
        if (!readNumber(size) || !readNumber(count)) return false;
        if (size > left()) return fail("a container's size is larger than what is left", start);
        // All items lie beside one another, so together they cannot be more than the bytes allow. Without this,
        // containers in one another could each claim all the bytes, and each claim takes memory before it shows wrong.
        const std::size_t items = count * smallestItem;
        if (items > size || items > _bytes.size() - _claimed)
            return fail("a container's count is larger than its size allows", start);
        _claimed += items;
        if (!takeMemory(containerMemory + count * itemMemory, start)) return false;
        const std::size_t outerEnd = _end;
        _end = _at + size;
        if (!readContent(count)) return false;
        if (_at != _end) return fail("a container's size is larger than its items", start);
        _end = outerEnd;
        return true;
    }

    bool readItems(Value& value, std::uint32_t count, std::size_t depth) {
        std::vector<Value> items(count);
        for (auto& item : items)
            if (!readValue(item, depth + 1)) return false;
        value = Array(std::move(items));
        return true;
    }

    bool readEntries(Value& value, std::uint32_t count, std::size_t start, std::size_t depth) {
        std::vector<Dictionary::Entry> entries(count);
        for (auto& entry : entries) {
            std::string_view key;
            if (!readText(key)) return false;
            entry.key = key;
            if (!readValue(entry.value, depth + 1)) return false;
        }
        auto dictionary = Dictionary::fromUniqueEntries(std::move(entries));
        if (!dictionary) return fail("a dictionary with equal keys", start);
        value = *dictionary;
        return true;
    }

    const std::string_view _bytes;
    std::size_t _at;
    std::size_t _end; // of the container being read
    const UUIDs _uuids;
    const std::size_t _nesting; // containers in one another
    const std::size_t _maximumMemory;
    std::size_t _memory = 0;
    std::size_t _claimed = 0; // bytes that the items of all containers take at least
    std::optional<std::string> _problem;
};

} // namespace

void appendCompact(std::string& out, const Value& value) {
    StringSink sink(out);
    Writer(sink).append(value);
}

std::size_t compactSize(const Value& value) {
    CountingSink sink;
    Writer(sink).append(value);
    return sink.position();
}

Result<Value> decodeCompact(std::string_view bytes, UUIDs uuids, std::size_t nesting) {
    return Reader(bytes, 0, uuids, nesting).read();
}

namespace linux_ {

void appendEntry(std::string& out, const Dictionary::Entry& entry) {
    StringSink sink(out);
    Writer(sink).appendEntry(entry, 1);
}

Result<DecodedMessage> decodeMessage(std::string_view bytes, std::size_t maximumSize) {
    Reader reader(bytes, 0, UUIDs::allowed, maximumNesting, maximumSize);
    Result<Value> content = reader.read();
    if (!content) return content.error();
    return DecodedMessage{*std::move(content), reader.memory()};
}

Result<Value> decodeCompactFile(std::string_view bytes, std::size_t nesting) {
    return Reader(bytes, compactMagic.size(), UUIDs::refused, nesting).read();
}

} // namespace linux_

} // namespace platform
