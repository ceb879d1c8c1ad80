#pragma once

#include "platform/Error.h"
#include "platform/Uuid.h"

#include <atomic>
#include <concepts>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <iterator>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

/// The one value type of the whole system: what manifests, messages, the registry and preferences are made of.
namespace platform {

class Array;
class Dictionary;

/// A moment, in seconds since 1970-01-01 00:00 UTC; fractions count.
struct Date {
    double seconds = 0;
    friend auto operator<=>(const Date&, const Date&) = default;
};

enum class Kind : std::uint8_t { none, boolean, integer, real, date, string, data, uuid, array, dictionary };

namespace detail {
/// Reference-counted storage; what follows the count is known to PropertyList.cpp alone.
struct Node {
    std::atomic<std::uint32_t> references{1};
    bool isDeferred = false; // data that is still a value

    void addReference() noexcept { references.fetch_add(1, std::memory_order_relaxed); }
    /// True when that was the last one.
    bool dropReference() noexcept {
        // The only holder needs no atomic subtraction: nobody else can take a reference meanwhile.
        if (references.load(std::memory_order_acquire) == 1) return true;
        return references.fetch_sub(1, std::memory_order_acq_rel) == 1;
    }
};
void destroy(Kind kind, Node* node) noexcept;
struct Contents; // reaches into values for PropertyList.cpp
} // namespace detail

/// One value. Copying it never copies what it holds: strings, data, arrays and dictionaries are shared storage.
/// A default-made value holds nothing and stands for "absent"; it is never stored inside an array or dictionary.
/// Values may be read from any thread; storage that one thread changes must not be read by another meanwhile.
class Value {
public:
    Value() noexcept : _bits(0), _kind(Kind::none), _unsigned(false), _digest(0) {}
    Value(bool value) noexcept; // NOLINT(google-explicit-constructor)
    template <std::signed_integral T>
    Value(T value) noexcept : Value(Signed{static_cast<std::int64_t>(value)}) {} // NOLINT(google-explicit-constructor)
    template <std::unsigned_integral T>
        requires(!std::same_as<T, bool>)
    Value(T value) noexcept : Value(Unsigned{static_cast<std::uint64_t>(value)}) {} // NOLINT
    Value(double value) noexcept; // NOLINT(google-explicit-constructor)
    Value(Date value) noexcept;   // NOLINT(google-explicit-constructor)
    /// Bytes that are NUL or no well-formed UTF-8 (file names may hold such) become U+FFFD, so that every string that
    /// exists can travel.
    Value(std::string_view value);                                      // NOLINT(google-explicit-constructor)
    Value(const std::string& value) : Value(std::string_view(value)) {} // NOLINT(google-explicit-constructor)
    Value(const char* value) : Value(std::string_view(value)) {}        // NOLINT(google-explicit-constructor)
    Value(const UUID& value);                                           // NOLINT(google-explicit-constructor)
    Value(const Array& value);                                          // NOLINT(google-explicit-constructor)
    Value(const Dictionary& value);                                     // NOLINT(google-explicit-constructor)
    static Value data(std::string_view bytes);

    // Inline: forms and replies are copies and ends of values for the most part.
    Value(const Value& other) noexcept
        : _bits(other._bits), _kind(other._kind), _unsigned(other._unsigned), _digest(other._digest) {
        if (hasNode()) node()->addReference();
    }
    Value(Value&& other) noexcept
        : _bits(other._bits), _kind(other._kind), _unsigned(other._unsigned), _digest(other._digest) {
        other._kind = Kind::none;
        other._bits = 0;
    }
    Value& operator=(const Value& other) noexcept {
        Value copy(other); // first, for `other` may live inside what this value lets go
        return *this = std::move(copy);
    }
    Value& operator=(Value&& other) noexcept {
        Value taken(std::move(other));
        std::swap(_bits, taken._bits);
        std::swap(_kind, taken._kind);
        std::swap(_unsigned, taken._unsigned);
        std::swap(_digest, taken._digest);
        return *this;
    }
    ~Value() {
        if (hasNode() && node()->dropReference()) detail::destroy(_kind, node());
    }

    Kind kind() const noexcept { return _kind; }
    /// False only for "absent".
    explicit operator bool() const noexcept { return _kind != Kind::none; }

    // Each answers none when the value is of another kind. Views stay good as long as some value shares the storage.
    std::optional<bool> boolean() const noexcept;
    /// Integers only; none also for an integer outside the asked range.
    std::optional<std::int64_t> int64() const noexcept;
    std::optional<std::uint64_t> uint64() const noexcept;
    /// Reals only.
    std::optional<double> real() const noexcept;
    std::optional<Date> date() const noexcept;
    std::optional<std::string_view> string() const noexcept;
    std::optional<std::string_view> data() const noexcept;
    std::optional<UUID> uuid() const noexcept;
    std::optional<Array> array() const noexcept;
    std::optional<Dictionary> dictionary() const& noexcept;
    std::optional<Dictionary> dictionary() && noexcept; // saves counting a share that ends at once

    /// A boolean, an integer or a real: the kinds that compare by number.
    bool isNumber() const noexcept;
    /// Whether this is a string that `text` begins with, byte for byte. Looks at the storage of few that are not.
    bool isBeginningOf(std::string_view text) const noexcept;
    /// The number as an integer, as a property list's number object reads: booleans give 0 or 1, reals are truncated
    /// toward zero and clamped, integers beyond the signed range wrap. None when this is no number.
    std::optional<std::int64_t> integerValue() const noexcept;
    /// The number as a boolean: true unless it is zero. None when this is no number.
    std::optional<bool> booleanValue() const noexcept;

    /// Equal kinds and contents; numbers and booleans compare by exact numeric value, so 1 equals true and 1.0. A real
    /// that is not a number equals nothing, itself included.
    friend bool operator==(const Value& left, const Value& right) noexcept;

    /// The value as one line for logs: strings bare, `{key = value; ...}`, `(item, ...)`, "(null)" for an absent one.
    /// Control characters and bytes that are no UTF-8 are escaped, and long values are cut (see
    /// `maximumDescriptionLength` in PropertyList.cpp), so that no message can forge or flood the log.
    std::string description() const;
    /// Appends it to `out`.
    void describeTo(std::string& out) const;

private:
    struct Signed {
        std::int64_t value;
    };
    struct Unsigned {
        std::uint64_t value;
    };
    explicit Value(Signed value) noexcept;
    explicit Value(Unsigned value) noexcept;
    Value(Kind kind, detail::Node* node) noexcept;
    bool hasNode() const noexcept { return _kind >= Kind::string; }
    detail::Node* node() const noexcept { return reinterpret_cast<detail::Node*>(static_cast<std::uintptr_t>(_bits)); }

    friend class Array;
    friend class MutableArray;
    friend class Dictionary;
    friend class MutableDictionary;
    friend struct detail::Contents;

    std::uint64_t _bits;
    Kind _kind;
    bool _unsigned;        // an integer above the signed range; smaller ones are always held signed
    std::uint32_t _digest; // of a string: tells most of those apart that are not equal, without a look at the bytes
};

/// A read-only view of ordered values: a handle on shared storage.
class Array {
public:
    Array();
    Array(std::initializer_list<Value> values);
    explicit Array(std::vector<Value> values);
    template <class Range>
        requires(!std::same_as<Range, std::vector<Value>> && !std::derived_from<Range, Array> &&
                 requires(const Range& range) { Value(*range.begin()); })
    static Array of(const Range& range) {
        std::vector<Value> values;
        if constexpr (requires { range.size(); }) values.reserve(range.size());
        for (const auto& element : range) values.emplace_back(element);
        return Array(std::move(values));
    }

    std::size_t size() const noexcept;
    bool empty() const noexcept { return size() == 0; }
    const Value& operator[](std::size_t index) const noexcept;
    const Value* begin() const noexcept;
    const Value* end() const noexcept;

    friend bool operator==(const Array& left, const Array& right) noexcept;

protected:
    explicit Array(Value storage) noexcept : _storage(std::move(storage)) {}
    Value _storage; // always of kind array

    friend class Value;
};

/// An array handle that may also change the storage it shares; it converts to `Array` without copying.
class MutableArray : public Array {
public:
    MutableArray();
    /// A new array with the same elements; the elements themselves are shared.
    static MutableArray copyOf(const Array& other);
    void append(Value value);
};

/// A read-only view of string keys to values: a handle on shared storage. Enumerates in the order in which the keys
/// were first set. Lookup costs a short walk up to `indexThreshold` keys and a binary search beyond, so no choice of
/// keys makes it slow.
class Dictionary {
public:
    struct Entry {
        Value key; // always a string
        Value value;
        std::string_view name() const noexcept { return *key.string(); }
    };

    Dictionary();
    Dictionary(std::initializer_list<std::pair<std::string_view, Value>> entries);
    /// Takes the entries in order. None when two keys are equal.
    static std::optional<Dictionary> fromUniqueEntries(std::vector<Entry> entries);

    std::size_t size() const noexcept;
    bool empty() const noexcept { return size() == 0; }
    bool contains(std::string_view key) const noexcept { return find(key) != nullptr; }
    /// The value under `key`; an absent value when there is none.
    Value operator[](std::string_view key) const noexcept;
    /// As `operator[]` without sharing the value; null when there is none. Good until the storage changes.
    const Value* find(std::string_view key) const noexcept;
    class Iterator;
    Iterator begin() const noexcept;
    Iterator end() const noexcept;

    // Typed lookups: none when absent or of another kind.
    std::optional<std::string_view> string(std::string_view key) const noexcept;
    std::optional<std::uint64_t> uint64(std::string_view key) const noexcept;
    std::optional<UUID> uuid(std::string_view key) const noexcept;
    std::optional<Array> array(std::string_view key) const noexcept;
    std::optional<Dictionary> dictionary(std::string_view key) const noexcept;

    /// True when both handles share one storage.
    bool sharesStorageWith(const Dictionary& other) const noexcept;
    /// The same for a value, which need not be a dictionary. No storage is looked at.
    bool isStorageOf(const Value& value) const noexcept {
        return value._kind == Kind::dictionary && value._bits == _storage._bits;
    }

    /// A new dictionary with the same entries that keeps its compact encoding, for one that is encoded again and again.
    /// Neither it nor anything in it may change from now on.
    Dictionary keepingEncoding() const;

    /// Same keys with equal values, in any order.
    friend bool operator==(const Dictionary& left, const Dictionary& right) noexcept;

protected:
    explicit Dictionary(Value storage) noexcept : _storage(std::move(storage)) {}
    Value _storage; // always of kind dictionary

    friend class Value;
};

/// Good until the storage changes. In two stretches where a dictionary extends another.
class Dictionary::Iterator {
public:
    using iterator_category = std::forward_iterator_tag;
    using value_type = Entry;
    using difference_type = std::ptrdiff_t;
    using pointer = const Entry*;
    using reference = const Entry&;

    Iterator() = default;
    Iterator(const Entry* at, const Entry* endOfFirst, const Entry* second) noexcept
        : _at(at), _endOfFirst(endOfFirst), _second(second) {}
    const Entry& operator*() const noexcept { return *_at; }
    const Entry* operator->() const noexcept { return _at; }
    Iterator& operator++() noexcept {
        if (++_at == _endOfFirst) _at = _second;
        return *this;
    }
    Iterator operator++(int) noexcept {
        const Iterator before = *this;
        ++*this;
        return before;
    }
    friend bool operator==(const Iterator& left, const Iterator& right) noexcept { return left._at == right._at; }

private:
    const Entry* _at = nullptr;
    const Entry* _endOfFirst = nullptr; // null when there is one stretch only
    const Entry* _second = nullptr;
};

/// A dictionary handle that may also change the storage it shares; it converts to `Dictionary` without copying.
class MutableDictionary : public Dictionary {
public:
    MutableDictionary();
    MutableDictionary(std::initializer_list<std::pair<std::string_view, Value>> entries) : Dictionary(entries) {}
    /// A new dictionary with the same entries; the values themselves are shared.
    static MutableDictionary copyOf(const Dictionary& other);
    /// The same for a dictionary that keeps its encoding: the copy begins with the entries of `kept` itself, and so
    /// costs nothing until one of these is changed.
    static MutableDictionary extending(const Dictionary& kept);
    /// Whether it is what `extending` made of `kept`, and still has the very same values.
    bool isUnchangedFrom(const Dictionary& kept) const noexcept;

    /// Sets or replaces. `value` must not be absent.
    void set(std::string_view key, Value value);
    /// The same with a string as the key, whose storage is shared: for keys that are set again and again.
    template <std::same_as<Value> Key> void set(const Key& key, Value value) { setSharing(key, std::move(value)); }
    /// Does nothing when there is no such key. The other keys keep their order.
    void remove(std::string_view key);
    /// Sets every entry of `other`.
    void merge(const Dictionary& other);

private:
    void setSharing(const Value& key, Value value);
};

/// Bounds of the decoders. Each protects the daemon from its input; none is reachable by a sensible value.
inline constexpr std::size_t maximumNesting = 64; // recursion in decoders, encoders and comparison stays shallow
/// For manifests and what is merged into them: messages carry these inside a form, which is inside a list of forms, and
/// have to stay decodable.
inline constexpr std::size_t maximumManifestNesting = maximumNesting - 8;

/// Domain of decoding errors; the description says what was wrong and where.
inline constexpr const char* propertyListErrorDomain = "PropertyList";

enum class UUIDs { allowed, refused }; // property lists on disk hold none; messages may

// The compact encoding. It serves files, the wire and values carried inside messages. `docs/wire-protocol.md` is its
// definition. A file begins with `compactMagic`; a message body does not.
inline constexpr std::string_view compactMagic = "vlist16\n";

/// Appends the encoding of `value`, without magic. The value must not be absent. A string that is no UTF-8 or holds
/// NUL, a date outside the years 1 to 9999 and nesting beyond `maximumNesting` are encoded, but no decoder takes them.
void appendCompact(std::string& out, const Value& value);
/// How many bytes that is.
std::size_t compactSize(const Value& value);
/// The same encoding as data. It is made when somebody looks at it, and in a message where the message is written: a
/// long answer is copied once. So nothing in `value` may change from now on.
Value compactData(const Value& value);
/// Decodes exactly one value that fills `bytes`. Strict: UTF-8 checked, no NUL in strings and keys, no duplicate
/// keys, every size checked against what is left before anything is allocated, containers nested in one another at most
/// `nesting` deep. `nesting` is at most `maximumNesting`.
Result<Value> decodeCompact(std::string_view bytes, UUIDs uuids, std::size_t nesting = maximumNesting);

/// The XML encoding of a whole file, ending in a newline. An error for what no XML file can hold: UUIDs, control
/// characters other than tab, newline and carriage return, text that is no UTF-8, dates outside the years 1 to 9999,
/// nesting beyond `maximumNesting`. All else comes back from `decodePropertyList` as it was, to the last bit of a date
/// (written as 2026-11-22T21:00:00Z, with as many decimals of a second as it takes).
Result<std::string> encodeXML(const Value& value);

/// Decodes a file in either encoding, told apart by its first bytes. Equally strict, with the same `nesting`; XML with
/// a document type or with entities beyond the five predefined ones is refused.
Result<Value> decodePropertyList(std::string_view bytes, std::size_t nesting = maximumNesting);

} // namespace platform
