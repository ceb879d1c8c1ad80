#include "platform/PropertyList.h"

#include "platform/linux/PropertyListCoding.h"
#include "platform/linux/Utf8.h"

#include <algorithm>
#include <bit>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <mutex>
#include <new>

namespace platform {

namespace {

/// From this many keys on a dictionary keeps a sorted index; below it a walk is faster.
/// Forms, the dictionaries made most often, stay below.
constexpr std::size_t indexThreshold = 32;

/// A log line stays readable, and no peer fills the log with one message.
constexpr std::size_t maximumDescriptionLength = 4096;
constexpr std::string_view ellipsis = "…";

/// How many bytes of data a description shows.
constexpr std::size_t describedDataBytes = 16;

/// `text` with a replacement character for each byte that is NUL or not part of well-formed UTF-8.
std::string wellFormed(std::string_view text) {
    constexpr std::string_view replacement = "\xEF\xBF\xBD";
    std::string result;
    for (std::size_t at = 0; at < text.size();) {
        const std::size_t length = text[at] == '\0' ? 0 : linux_::utf8Length(text, at);
        if (length == 0) {
            result += replacement;
            ++at;
        } else {
            result += text.substr(at, length);
            at += length;
        }
    }
    return result;
}

void require(bool condition, const char* text) noexcept {
    if (condition) return;
    std::fprintf(stderr, "%s\n", text);
    std::abort();
}

} // namespace

namespace detail {

namespace {

std::uint32_t digestOf(std::string_view text) noexcept {
    if (text.empty()) return 0;
    const auto byte = [&](std::size_t at) { return std::uint32_t{static_cast<unsigned char>(text[at])}; };
    return static_cast<std::uint32_t>(text.size()) ^ (byte(0) << 8U) ^ (byte(text.size() / 2) << 16U) ^
           (byte(text.size() - 1) << 24U);
}

} // namespace

/// The bytes follow the node in the same allocation.
struct BytesNode : Node {
    explicit BytesNode(std::size_t count) noexcept : length(count) {}
    const char* bytes() const noexcept { return reinterpret_cast<const char*>(this + 1); }
    std::string_view view() const noexcept { return {bytes(), length}; }

    const std::size_t length;

    static BytesNode* make(std::string_view bytes) {
        void* storage = ::operator new(sizeof(BytesNode) + bytes.size());
        auto* node = new (storage) BytesNode(bytes.size());
        if (!bytes.empty()) std::memcpy(node->space(), bytes.data(), bytes.size());
        return node;
    }
    char* space() noexcept { return reinterpret_cast<char*>(this + 1); }
    static void destroy(BytesNode* node) noexcept {
        node->~BytesNode();
        ::operator delete(node);
    }
    struct Destroy {
        void operator()(BytesNode* node) const noexcept { destroy(node); }
    };
};

/// Data that is the encoding of a value.
struct DeferredNode : Node {
    explicit DeferredNode(Value value) noexcept : content(std::move(value)) { isDeferred = true; }
    std::string_view bytes() {
        std::call_once(isMade, [this] { appendCompact(encoding, content); });
        return encoding;
    }

    const Value content;

private:
    std::once_flag isMade;
    std::string encoding; // once somebody looked
};

struct UUIDNode : Node {
    explicit UUIDNode(const UUID& value) noexcept : uuid(value) {}
    const UUID uuid;
};

struct ContainerNode : Node {
    explicit ContainerNode(Kind containerKind) noexcept : kind(containerKind) {}
    ContainerNode* next = nullptr; // links containers whose last reference is gone
    const Kind kind;
};

struct ArrayNode : ContainerNode {
    explicit ArrayNode(std::vector<Value> content = {}) noexcept
        : ContainerNode(Kind::array), values(std::move(content)) {}
    std::vector<Value> values;
};

struct DictionaryNode : ContainerNode {
    DictionaryNode() noexcept : ContainerNode(Kind::dictionary) {}

    std::vector<Dictionary::Entry> entries;
    /// Of the entries, for a dictionary that does not change any more.
    std::unique_ptr<BytesNode, BytesNode::Destroy> encoding;
    DictionaryNode* base = nullptr;   // shared, and keeps its encoding; its entries come before the node's own
    std::vector<std::uint32_t> index; // positions in `entries` by `before`; empty up to `indexThreshold` keys

    /// Any total order will do: comparing lengths first settles most pairs without looking at the bytes.
    static bool before(std::string_view left, std::string_view right) noexcept {
        if (left.size() != right.size()) return left.size() < right.size();
        return left < right;
    }

    std::vector<std::uint32_t>::const_iterator lowerBound(std::string_view key) const noexcept {
        return std::lower_bound(
            index.begin(), index.end(), key,
            [this](std::uint32_t position, std::string_view wanted) { return before(name(position), wanted); });
    }

    std::optional<std::size_t> find(std::string_view key) const noexcept {
        return index.empty() ? findWalking(key, digestOf(key)) : findInIndex(key);
    }
    std::optional<std::size_t> findWalking(std::string_view key, std::uint32_t digest) const noexcept;
    std::optional<std::size_t> findInIndex(std::string_view key) const noexcept {
        const auto place = lowerBound(key);
        if (place == index.end() || name(*place) != key) return std::nullopt;
        return *place;
    }

    std::size_t size() const noexcept { return entries.size() + (base != nullptr ? base->entries.size() : 0); }
    /// Also in the base.
    const Value* valueUnder(std::string_view key) const noexcept {
        if (const auto position = find(key)) return &entries[*position].value;
        return base != nullptr ? base->valueUnder(key) : nullptr;
    }
    Dictionary::Iterator begin() const noexcept {
        if (base == nullptr || base->entries.empty()) return {entries.data(), nullptr, nullptr};
        const auto& first = base->entries;
        return {first.data(), first.data() + first.size(), entries.data()};
    }
    Dictionary::Iterator end() const noexcept { return {entries.data() + entries.size(), nullptr, nullptr}; }
    /// Takes over the entries of the base, for one of them is about to change.
    void takeOverBase();

    /// `shared` is the key as a value, or absent.
    void set(std::string_view key, Value value, const Value& shared = {});
    void erase(std::size_t position) noexcept;

    /// Sorts all keys anew; false when two are equal.
    bool rebuildIndex();

    std::string_view name(std::size_t position) const noexcept;
};

/// Reaches into values for what their public operations need not show.
struct Contents {
    static Kind kind(const Value& value) noexcept { return value._kind; }
    static std::uint64_t bits(const Value& value) noexcept { return value._bits; }
    static bool isUnsigned(const Value& value) noexcept { return value._unsigned; }
    static Node* node(const Value& value) noexcept {
        return reinterpret_cast<Node*>(static_cast<std::uintptr_t>(value._bits));
    }
    static const BytesNode& bytes(const Value& value) noexcept { return *static_cast<BytesNode*>(node(value)); }
    static ArrayNode& array(const Value& value) noexcept { return *static_cast<ArrayNode*>(node(value)); }
    static DictionaryNode& dictionary(const Value& value) noexcept {
        return *static_cast<DictionaryNode*>(node(value));
    }

    static std::uint32_t digest(const Value& value) noexcept { return value._digest; }
    /// The same number, or the same storage.
    static bool isSame(const Value& left, const Value& right) noexcept {
        return left._kind == right._kind && left._bits == right._bits && left._unsigned == right._unsigned;
    }
    static DeferredNode* deferred(const Value& value) noexcept {
        const bool isDeferred = value._kind == Kind::data && node(value)->isDeferred;
        return isDeferred ? static_cast<DeferredNode*>(node(value)) : nullptr;
    }
    static Value newDeferred(const Value& content) { return {Kind::data, new DeferredNode(content)}; }
    static Value newArray() { return {Kind::array, new ArrayNode}; }
    static Value newDictionary() { return {Kind::dictionary, new DictionaryNode}; }
    static Value valueOf(DictionaryNode* node) noexcept { return {Kind::dictionary, node}; }

    /// Takes the reference out of `value`, which becomes absent.
    static Node* take(Value& value) noexcept {
        Node* taken = value.hasNode() ? node(value) : nullptr;
        value._kind = Kind::none;
        return taken;
    }
};

std::string_view DictionaryNode::name(std::size_t position) const noexcept {
    return Contents::bytes(entries[position].key).view();
}

std::optional<std::size_t> DictionaryNode::findWalking(std::string_view key, std::uint32_t digest) const noexcept {
    for (std::size_t i = 0; i < entries.size(); ++i)
        if (Contents::digest(entries[i].key) == digest && name(i) == key) return i;
    return std::nullopt;
}

void DictionaryNode::takeOverBase() {
    if (base == nullptr) return;
    const Value ending = Contents::valueOf(std::exchange(base, nullptr)); // the share in it
    entries.insert(entries.begin(), Contents::dictionary(ending).entries.begin(),
                   Contents::dictionary(ending).entries.end());
    rebuildIndex();
}

void DictionaryNode::set(std::string_view key, Value value, const Value& shared) {
    require(static_cast<bool>(value), "an absent value cannot be in a dictionary");
    if (base != nullptr) {
        const Value* present = base->valueUnder(key);
        if (present != nullptr && Contents::isSame(*present, value)) return;
        if (present != nullptr) takeOverBase();
    }
    if (const auto position = find(key)) {
        std::swap(entries[*position].value, value); // the old value goes last: `key` may point into it
        return;
    }
    Value name = shared ? shared : Value(key);
    if (!index.empty()) {
        const auto place = lowerBound(key);
        index.insert(place, static_cast<std::uint32_t>(entries.size()));
    }
    entries.push_back({std::move(name), std::move(value)});
    if (index.empty() && entries.size() > indexThreshold) rebuildIndex();
}

void DictionaryNode::erase(std::size_t position) noexcept {
    if (!index.empty()) {
        index.erase(lowerBound(name(position)));
        for (auto& later : index)
            if (later > position) --later;
    }
    entries.erase(entries.begin() + static_cast<std::ptrdiff_t>(position));
    if (entries.size() <= indexThreshold) index.clear();
}

bool DictionaryNode::rebuildIndex() {
    index.clear();
    if (entries.size() <= indexThreshold) {
        std::string_view names[indexThreshold];
        for (std::size_t i = 0; i < entries.size(); ++i) {
            names[i] = name(i);
            for (std::size_t j = 0; j < i; ++j)
                if (Contents::digest(entries[j].key) == Contents::digest(entries[i].key) && names[j] == names[i])
                    return false;
        }
        return true;
    }
    require(entries.size() <= UINT32_MAX, "a dictionary holds too many keys");
    index.resize(entries.size());
    for (std::size_t i = 0; i < index.size(); ++i) index[i] = static_cast<std::uint32_t>(i);
    std::sort(index.begin(), index.end(),
              [this](std::uint32_t left, std::uint32_t right) { return before(name(left), name(right)); });
    return std::adjacent_find(index.begin(), index.end(), [this](std::uint32_t left, std::uint32_t right) {
               return name(left) == name(right);
           }) == index.end();
}

namespace {

void destroyLeaf(Kind kind, Node* node) noexcept {
    if (kind == Kind::uuid)
        delete static_cast<UUIDNode*>(node);
    else if (node->isDeferred)
        delete static_cast<DeferredNode*>(node);
    else
        BytesNode::destroy(static_cast<BytesNode*>(node));
}

} // namespace

void destroy(Kind kind, Node* node) noexcept {
    if (kind < Kind::array) return destroyLeaf(kind, node);

    // Containers are emptied one after another instead of one within another: however deep they nest, the stack
    // stays as it is. The list needs no memory, so this cannot fail.
    auto* pending = static_cast<ContainerNode*>(node);
    const auto discard = [&pending](Value& value) {
        const Kind valueKind = value.kind();
        Node* taken = Contents::take(value);
        if (taken == nullptr || !taken->dropReference()) return;
        if (valueKind < Kind::array) return destroyLeaf(valueKind, taken);
        auto* container = static_cast<ContainerNode*>(taken);
        container->next = pending;
        pending = container;
    };
    while (pending != nullptr) {
        ContainerNode* container = pending;
        pending = container->next;
        if (container->kind == Kind::array) {
            auto* array = static_cast<ArrayNode*>(container);
            for (auto& value : array->values) discard(value);
            delete array;
        } else {
            auto* dictionary = static_cast<DictionaryNode*>(container);
            for (auto& entry : dictionary->entries) {
                discard(entry.key);
                discard(entry.value);
            }
            if (dictionary->base != nullptr && dictionary->base->dropReference()) {
                dictionary->base->next = pending;
                pending = dictionary->base;
            }
            delete dictionary;
        }
    }
}

} // namespace detail

using detail::Contents;

namespace {

std::uint64_t bitsOf(detail::Node* node) noexcept {
    return static_cast<std::uint64_t>(reinterpret_cast<std::uintptr_t>(node));
}

// 2^63 and 2^64 as reals; both are exact.
constexpr double signedEnd = 9223372036854775808.0;
constexpr double unsignedEnd = 18446744073709551616.0;

/// An integer is `sign` times a magnitude, or a real that is none; so that unlike numbers compare without rounding.
struct Integer {
    bool isNegative;
    std::uint64_t bits; // two's complement
    friend bool operator==(const Integer&, const Integer&) = default;
};

/// None for reals with a fraction or beyond 64 bits, which equal no integer.
std::optional<Integer> asInteger(const Value& value) noexcept {
    if (const auto real = value.real()) {
        if (!(*real >= -signedEnd && *real < unsignedEnd) || std::trunc(*real) != *real) return std::nullopt;
        if (*real < 0) return Integer{true, static_cast<std::uint64_t>(static_cast<std::int64_t>(*real))};
        return Integer{false, static_cast<std::uint64_t>(*real)};
    }
    const bool isNegative = !Contents::isUnsigned(value) && static_cast<std::int64_t>(Contents::bits(value)) < 0;
    return Integer{isNegative, Contents::bits(value)};
}

bool numbersEqual(const Value& left, const Value& right) noexcept {
    const auto leftReal = left.real();
    const auto rightReal = right.real();
    if (leftReal && rightReal) return *leftReal == *rightReal;
    const auto leftInteger = asInteger(left);
    return leftInteger && leftInteger == asInteger(right);
}

/// Compares everything but the contents of containers, of which only kinds and sizes are looked at.
bool outsidesEqual(const Value& left, const Value& right) noexcept {
    if (left.isNumber()) return right.isNumber() && numbersEqual(left, right);
    if (left.kind() != right.kind()) return false;
    switch (left.kind()) {
    case Kind::date: return left.date()->seconds == right.date()->seconds;
    case Kind::string: return Contents::bytes(left).view() == Contents::bytes(right).view();
    case Kind::data: return left.data() == right.data();
    case Kind::uuid: return left.uuid() == right.uuid();
    case Kind::array: return Contents::array(left).values.size() == Contents::array(right).values.size();
    case Kind::dictionary: return Contents::dictionary(left).size() == Contents::dictionary(right).size();
    default: return true;
    }
}

} // namespace

Value::Value(bool value) noexcept : _bits(value ? 1 : 0), _kind(Kind::boolean), _unsigned(false), _digest(0) {}

Value::Value(Signed value) noexcept
    : _bits(static_cast<std::uint64_t>(value.value)), _kind(Kind::integer), _unsigned(false), _digest(0) {}

Value::Value(Unsigned value) noexcept
    : _bits(value.value),
      _kind(Kind::integer),
      _unsigned(value.value > static_cast<std::uint64_t>(INT64_MAX)),
      _digest(0) {}

Value::Value(double value) noexcept
    : _bits(std::bit_cast<std::uint64_t>(value)), _kind(Kind::real), _unsigned(false), _digest(0) {}

Value::Value(Date value) noexcept
    : _bits(std::bit_cast<std::uint64_t>(value.seconds)), _kind(Kind::date), _unsigned(false), _digest(0) {}

Value::Value(Kind kind, detail::Node* node) noexcept : _bits(bitsOf(node)), _kind(kind), _unsigned(false), _digest(0) {}

Value::Value(std::string_view value)
    : Value(Kind::string,
            linux_::firstBadByte(value) ? detail::BytesNode::make(wellFormed(value)) : detail::BytesNode::make(value)) {
    _digest = detail::digestOf(Contents::bytes(*this).view());
}

Value Value::data(std::string_view bytes) { return Value(Kind::data, detail::BytesNode::make(bytes)); }

Value::Value(const UUID& value) : Value(Kind::uuid, new detail::UUIDNode(value)) {}

Value::Value(const Array& value) : Value(value._storage) {}

Value::Value(const Dictionary& value) : Value(value._storage) {}

std::optional<bool> Value::boolean() const noexcept {
    if (_kind != Kind::boolean) return std::nullopt;
    return _bits != 0;
}

std::optional<std::int64_t> Value::int64() const noexcept {
    if (_kind != Kind::integer || _unsigned) return std::nullopt;
    return static_cast<std::int64_t>(_bits);
}

std::optional<std::uint64_t> Value::uint64() const noexcept {
    if (_kind != Kind::integer || (!_unsigned && static_cast<std::int64_t>(_bits) < 0)) return std::nullopt;
    return _bits;
}

std::optional<double> Value::real() const noexcept {
    if (_kind != Kind::real) return std::nullopt;
    return std::bit_cast<double>(_bits);
}

std::optional<Date> Value::date() const noexcept {
    if (_kind != Kind::date) return std::nullopt;
    return Date{std::bit_cast<double>(_bits)};
}

std::optional<std::string_view> Value::string() const noexcept {
    if (_kind != Kind::string) return std::nullopt;
    return Contents::bytes(*this).view();
}

std::optional<std::string_view> Value::data() const noexcept {
    if (_kind != Kind::data) return std::nullopt;
    if (auto* const deferred = Contents::deferred(*this)) return deferred->bytes();
    return Contents::bytes(*this).view();
}

std::optional<UUID> Value::uuid() const noexcept {
    if (_kind != Kind::uuid) return std::nullopt;
    return static_cast<detail::UUIDNode*>(node())->uuid;
}

std::optional<Array> Value::array() const noexcept {
    if (_kind != Kind::array) return std::nullopt;
    return Array(*this);
}

std::optional<Dictionary> Value::dictionary() const& noexcept {
    if (_kind != Kind::dictionary) return std::nullopt;
    return Dictionary(*this);
}

std::optional<Dictionary> Value::dictionary() && noexcept {
    if (_kind != Kind::dictionary) return std::nullopt;
    return Dictionary(std::move(*this));
}

bool Value::isNumber() const noexcept {
    return _kind == Kind::boolean || _kind == Kind::integer || _kind == Kind::real;
}

bool Value::isBeginningOf(std::string_view text) const noexcept {
    if (_kind != Kind::string) return false;
    // The lowest byte of a digest is that of the length.
    for (std::size_t length = _digest & 0xFFU; length <= text.size(); length += 0x100) {
        const auto beginning = text.substr(0, length);
        if (detail::digestOf(beginning) == _digest && Contents::bytes(*this).view() == beginning) return true;
    }
    return false;
}

std::optional<std::int64_t> Value::integerValue() const noexcept {
    if (!isNumber()) return std::nullopt;
    const auto number = real();
    if (!number) return static_cast<std::int64_t>(_bits);
    if (std::isnan(*number)) return 0;
    if (*number >= signedEnd) return INT64_MAX;
    if (*number < -signedEnd) return INT64_MIN;
    return static_cast<std::int64_t>(*number);
}

std::optional<bool> Value::booleanValue() const noexcept {
    if (!isNumber()) return std::nullopt;
    if (const auto number = real()) return *number != 0;
    return _bits != 0;
}

bool operator==(const Value& left, const Value& right) noexcept {
    if (!outsidesEqual(left, right)) return false;
    if (left.kind() < Kind::array) return true;

    // A list of what is still to be compared, instead of recursion: containers built in the process may nest deeper
    // than decoded ones.
    std::vector<std::pair<const Value*, const Value*>> pending{{&left, &right}};
    const auto differs = [&pending](const Value& one, const Value& other) {
        if (!outsidesEqual(one, other)) return true;
        if (one.kind() >= Kind::array) pending.emplace_back(&one, &other);
        return false;
    };
    while (!pending.empty()) {
        const auto [one, other] = pending.back();
        pending.pop_back();
        if (one->kind() == Kind::array) {
            const auto& values = Contents::array(*one).values;
            const auto& others = Contents::array(*other).values;
            for (std::size_t i = 0; i < values.size(); ++i)
                if (differs(values[i], others[i])) return false;
            continue;
        }
        const auto& others = Contents::dictionary(*other);
        for (const auto& entry : Contents::dictionary(*one)) {
            const Value* value = others.valueUnder(entry.name());
            if (value == nullptr || differs(entry.value, *value)) return false;
        }
    }
    return true;
}

namespace {

/// Writes a description and stops taking text once the limit is reached.
class Describer {
public:
    explicit Describer(std::string& out) : _out(out), _start(out.size()), _limit(_start + limit) {}

    void describe(const Value& value) {
        append(value, 0);
        if (!isFull()) return;
        std::size_t end = _limit;
        while (end > _start && (static_cast<unsigned char>(_out[end]) & 0xC0U) == 0x80U) --end;
        _out.resize(end);
        _out += ellipsis;
    }

private:
    static constexpr std::size_t limit = maximumDescriptionLength - ellipsis.size();

    bool isFull() const { return _out.size() > _limit; }

    void append(const Value& value, std::size_t depth) {
        if (isFull()) return;
        switch (value.kind()) {
        case Kind::none: _out += "(null)"; break;
        case Kind::boolean: _out += *value.boolean() ? "true" : "false"; break;
        case Kind::integer:
            if (const auto number = value.int64())
                appendNumber(*number);
            else
                appendNumber(*value.uint64());
            break;
        case Kind::real: appendNumber(*value.real()); break;
        case Kind::date:
            _out += "<date ";
            appendNumber(value.date()->seconds);
            _out += '>';
            break;
        case Kind::string: appendText(*value.string()); break;
        case Kind::data: appendData(*value.data()); break;
        case Kind::uuid: _out += value.uuid()->text(); break;
        case Kind::array: appendArray(Contents::array(value).values, depth); break;
        case Kind::dictionary: appendDictionary(Contents::dictionary(value), depth); break;
        }
    }

    template <class Number> void appendNumber(Number number) {
        char digits[32];
        _out.append(digits, std::to_chars(digits, digits + sizeof digits, number).ptr);
    }

    void appendData(std::string_view bytes) {
        _out += '<';
        appendNumber(bytes.size());
        _out += bytes.size() == 1 ? " byte" : " bytes";
        if (!bytes.empty()) _out += ' ';
        for (const char c : bytes.substr(0, describedDataBytes)) appendHexadecimal(c);
        if (bytes.size() > describedDataBytes) _out += ellipsis;
        _out += '>';
    }

    void appendHexadecimal(char c) {
        static constexpr char digits[] = "0123456789abcdef";
        _out += digits[static_cast<unsigned char>(c) >> 4U];
        _out += digits[static_cast<unsigned char>(c) & 0x0FU];
    }

    /// Text as it is, but for what could end a line, steer a terminal or break the encoding of the log.
    void appendText(std::string_view text) {
        for (std::size_t at = 0; at < text.size() && !isFull();) {
            if (const std::size_t plain = linux_::plainLength(text.substr(at)); plain > 0) {
                _out += text.substr(at, std::min(plain, _limit + 1 - _out.size()));
                at += plain;
                continue;
            }
            const std::size_t length = linux_::utf8Length(text, at);
            const std::string_view character = text.substr(at, length == 0 ? 1 : length);
            if (length == 0 || isControl(character)) {
                for (const char c : character) {
                    _out += "\\x";
                    appendHexadecimal(c);
                }
            } else {
                _out += character;
            }
            at += character.size();
        }
    }

    static bool isControl(std::string_view character) {
        const auto first = static_cast<unsigned char>(character[0]);
        if (character.size() == 1) return first < 0x20 || first == 0x7F;
        if (first == 0xC2) return static_cast<unsigned char>(character[1]) < 0xA0; // U+0080 to U+009F
        return character == "\u2028" || character == "\u2029";                     // line and paragraph separator
    }

    void appendArray(const std::vector<Value>& values, std::size_t depth) {
        if (depth == maximumNesting) return appendNested();
        _out += '(';
        bool isFirst = true;
        for (const auto& value : values) {
            if (isFull()) return;
            if (!isFirst) _out += ", ";
            isFirst = false;
            append(value, depth + 1);
        }
        _out += ')';
    }

    void appendDictionary(const detail::DictionaryNode& entries, std::size_t depth) {
        if (depth == maximumNesting) return appendNested();
        _out += '{';
        bool isFirst = true;
        for (const auto& entry : entries) {
            if (isFull()) return;
            if (!isFirst) _out += "; ";
            isFirst = false;
            appendText(entry.name());
            _out += " = ";
            append(entry.value, depth + 1);
        }
        _out += '}';
    }

    void appendNested() { _out += ellipsis; }

    std::string& _out;
    const std::size_t _start;
    const std::size_t _limit; // of `_out`
};

} // namespace

void Value::describeTo(std::string& out) const { Describer(out).describe(*this); }

std::string Value::description() const {
    std::string text;
    describeTo(text);
    return text;
}

namespace {

// What is empty and read-only is one and the same: most of them only stand in for what is not there. Kept for ever, for
// other statics may still hold it when the process ends.
const Value& emptyArray() {
    static const Value& storage = *new Value(Contents::newArray());
    return storage;
}

const Value& emptyDictionary() {
    static const Value& storage = *new Value(Contents::newDictionary());
    return storage;
}

} // namespace

Array::Array() : _storage(emptyArray()) {}

Array::Array(std::initializer_list<Value> values) : Array(std::vector<Value>(values)) {}

Array::Array(std::vector<Value> values) {
    for (const auto& value : values) require(static_cast<bool>(value), "an absent value cannot be in an array");
    _storage = Value(Kind::array, new detail::ArrayNode(std::move(values)));
}

std::size_t Array::size() const noexcept { return Contents::array(_storage).values.size(); }

const Value& Array::operator[](std::size_t index) const noexcept {
    const auto& values = Contents::array(_storage).values;
    require(index < values.size(), "array index out of range");
    return values[index];
}

const Value* Array::begin() const noexcept { return Contents::array(_storage).values.data(); }

const Value* Array::end() const noexcept { return begin() + size(); }

bool operator==(const Array& left, const Array& right) noexcept { return left._storage == right._storage; }

MutableArray::MutableArray() : Array(Contents::newArray()) {}

MutableArray MutableArray::copyOf(const Array& other) {
    MutableArray copy;
    auto& values = Contents::array(copy._storage).values;
    values.assign(other.begin(), other.end());
    return copy;
}

void MutableArray::append(Value value) {
    require(static_cast<bool>(value), "an absent value cannot be in an array");
    Contents::array(_storage).values.push_back(std::move(value));
}

Dictionary::Dictionary() : _storage(emptyDictionary()) {}

Dictionary::Dictionary(std::initializer_list<std::pair<std::string_view, Value>> entries)
    : _storage(Contents::newDictionary()) {
    for (const auto& [key, value] : entries) Contents::dictionary(_storage).set(key, value);
}

std::optional<Dictionary> Dictionary::fromUniqueEntries(std::vector<Entry> entries) {
    for (const auto& entry : entries)
        require(entry.key.kind() == Kind::string && entry.value, "a dictionary entry is a string and a value");
    Dictionary made(Contents::newDictionary());
    auto& node = Contents::dictionary(made._storage);
    node.entries = std::move(entries);
    if (!node.rebuildIndex()) return std::nullopt;
    return made;
}

std::size_t Dictionary::size() const noexcept { return Contents::dictionary(_storage).size(); }

Value Dictionary::operator[](std::string_view key) const noexcept {
    const Value* value = find(key);
    return value != nullptr ? *value : Value();
}

const Value* Dictionary::find(std::string_view key) const noexcept {
    return Contents::dictionary(_storage).valueUnder(key);
}

Dictionary::Iterator Dictionary::begin() const noexcept { return Contents::dictionary(_storage).begin(); }

Dictionary::Iterator Dictionary::end() const noexcept { return Contents::dictionary(_storage).end(); }

std::optional<std::string_view> Dictionary::string(std::string_view key) const noexcept {
    const Value* value = find(key);
    return value != nullptr ? value->string() : std::nullopt;
}

std::optional<std::uint64_t> Dictionary::uint64(std::string_view key) const noexcept {
    const Value* value = find(key);
    return value != nullptr ? value->uint64() : std::nullopt;
}

std::optional<UUID> Dictionary::uuid(std::string_view key) const noexcept {
    const Value* value = find(key);
    return value != nullptr ? value->uuid() : std::nullopt;
}

std::optional<Array> Dictionary::array(std::string_view key) const noexcept {
    const Value* value = find(key);
    return value != nullptr ? value->array() : std::nullopt;
}

std::optional<Dictionary> Dictionary::dictionary(std::string_view key) const noexcept {
    const Value* value = find(key);
    return value != nullptr ? value->dictionary() : std::nullopt;
}

Dictionary Dictionary::keepingEncoding() const {
    MutableDictionary copy = MutableDictionary::copyOf(*this);
    auto& node = Contents::dictionary(copy._storage);
    node.takeOverBase();
    node.entries.shrink_to_fit();
    std::string encoding;
    for (const auto& entry : node.entries) linux_::appendEntry(encoding, entry);
    node.encoding.reset(detail::BytesNode::make(encoding));
    return copy;
}

Value compactData(const Value& value) {
    require(static_cast<bool>(value), "an absent value has no encoding");
    return Contents::newDeferred(value);
}

namespace linux_ {

EncodingParts encodingParts(const Value& dictionary) noexcept {
    const auto& node = Contents::dictionary(dictionary);
    if (node.encoding) return {node.encoding->view(), node.entries.size(), {}};
    if (node.base == nullptr) return {{}, 0, node.entries};
    return {node.base->encoding->view(), node.base->entries.size(), node.entries};
}

const Value* deferredContent(const Value& data) noexcept {
    const auto* const deferred = Contents::deferred(data);
    return deferred != nullptr ? &deferred->content : nullptr;
}

std::span<const Value> itemsOf(const Value& array) noexcept { return Contents::array(array).values; }

} // namespace linux_

bool Dictionary::sharesStorageWith(const Dictionary& other) const noexcept {
    return Contents::node(_storage) == Contents::node(other._storage);
}

bool operator==(const Dictionary& left, const Dictionary& right) noexcept { return left._storage == right._storage; }

MutableDictionary::MutableDictionary() : Dictionary(Contents::newDictionary()) {}

MutableDictionary MutableDictionary::copyOf(const Dictionary& other) {
    MutableDictionary copy;
    const Value shared(other);
    const auto& from = Contents::dictionary(shared);
    auto& to = Contents::dictionary(copy._storage);
    to.entries = from.entries;
    to.index = from.index;
    if (from.base != nullptr) from.base->addReference();
    to.base = from.base;
    return copy;
}

MutableDictionary MutableDictionary::extending(const Dictionary& kept) {
    const Value shared(kept);
    auto& base = Contents::dictionary(shared);
    require(base.encoding != nullptr, "only a dictionary that keeps its encoding can be extended");
    MutableDictionary extension;
    base.addReference();
    Contents::dictionary(extension._storage).base = &base;
    return extension;
}

bool MutableDictionary::isUnchangedFrom(const Dictionary& kept) const noexcept {
    const auto& node = Contents::dictionary(_storage);
    const Value shared(kept);
    return node.base == &Contents::dictionary(shared) && node.entries.empty();
}

void MutableDictionary::set(std::string_view key, Value value) {
    Contents::dictionary(_storage).set(key, std::move(value));
}

void MutableDictionary::setSharing(const Value& key, Value value) {
    require(key.kind() == Kind::string, "a key is a string");
    Contents::dictionary(_storage).set(Contents::bytes(key).view(), std::move(value), key);
}

void MutableDictionary::remove(std::string_view key) {
    auto& node = Contents::dictionary(_storage);
    if (node.base != nullptr && node.base->valueUnder(key) != nullptr) node.takeOverBase();
    if (const auto position = node.find(key)) node.erase(*position);
}

void MutableDictionary::merge(const Dictionary& other) {
    if (sharesStorageWith(other)) return;
    // One sort at the end instead of an insertion into the index for each new key.
    auto& node = Contents::dictionary(_storage);
    node.takeOverBase();
    std::vector<Entry> added;
    for (const auto& entry : other) {
        if (const auto position = node.find(entry.name()))
            node.entries[*position].value = entry.value;
        else
            added.push_back(entry);
    }
    if (added.empty()) return;
    node.entries.insert(node.entries.end(), std::make_move_iterator(added.begin()),
                        std::make_move_iterator(added.end()));
    node.rebuildIndex();
}

} // namespace platform
