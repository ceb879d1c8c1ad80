#pragma once

#include "platform/PropertyList.h"

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <initializer_list>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

namespace platform::linux_ {

/// Makes dictionaries hold the same text only once: all manifests have the same keys and many of the same values, which
/// in one after another would take more memory than what tells them apart. Any thread.
class SharedStrings {
public:
    /// An equal dictionary, in storage of its own that is no larger than it needs to be.
    Dictionary share(const Dictionary& dictionary);

private:
    friend class StoredDictionary;
    Dictionary shareLocked(const Dictionary& dictionary);
    Value shareLocked(const Value& value);

    /// A text at the place that its hash names. Each time it is met again counts against one time that another one
    /// would take its place: what many manifests hold stays, whatever each of them has for itself.
    struct Known {
        Value text;
        unsigned count = 0;
    };

    std::mutex _mutex;
    std::array<Known, 4096> _strings;
};

/// A dictionary of a bundle, in its compact encoding until somebody asks for it: most are never looked at. Any thread.
class StoredDictionary {
public:
    enum class Keeps {
        encoding,        // however often it is asked for
        whatWasAskedFor, // the dictionary in place of the encoding, once it was asked for
    };

    // `strings` must outlive this.
    StoredDictionary(std::string_view encoded, SharedStrings& strings, Keeps keeps)
        : _strings(strings), _keeps(keeps), _content(Value::data(encoded)) {}

    /// Empty when the stored bytes are damaged. Shares its storage with the next answer if that is what is kept.
    Dictionary dictionary() const;
    /// The compact encoding.
    std::string encoded() const;
    /// The value under `names[0]`, in that the one under `names[1]` and so on; absent when there is none. Decodes
    /// nothing else, and keeps nothing.
    Value find(std::initializer_list<std::string_view> names) const;
    using Visit = std::function<void(std::string_view text)>;
    /// Calls `visit` with that value if it is a string, and with each string in it if it is an array. False when it is
    /// absent. Makes no value of a string, for this is asked of every manifest.
    bool visitTexts(std::initializer_list<std::string_view> names, const Visit& visit) const;

private:
    Value content() const;
    static std::optional<std::string_view> findIn(const Value& encoded, std::initializer_list<std::string_view> names);

    SharedStrings& _strings;
    const Keeps _keeps;
    mutable std::atomic<bool> _isDecoded = false; // then `_content` stays as it is
    mutable Value _content;                       // the encoding as data, or the dictionary
};

/// Which directory it is: a directory that was replaced differs also when the new one got the old inode number.
struct DirectoryIdentity {
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    std::int64_t birth = 0; // nanoseconds since 1970; 0 where the file system keeps none
    friend bool operator==(const DirectoryIdentity&, const DirectoryIdentity&) = default;
};

/// What the registry keeps of one bundle directory. Immutable but for `evidence`.
struct BundleFacts {
    DirectoryIdentity identity;
    /// A digest of the states (inode, size, times) of every file that was read, and of an application's folder of
    /// plug-ins. While the files still give the same digest, nothing needs to be read again. The upper half is for what
    /// a cursory look sees. 0: read again in any case.
    mutable std::atomic<std::uint64_t> evidence = 0;
    std::uint64_t fingerprint = 0; // a digest of the content: manifest, entitlements, string tables
    bool hasResources = false;     // most bundles have none, and need no look for localized names
    std::string executable;        // its file name; empty without one, and for applications, whose program is not read
    std::shared_ptr<const StoredDictionary> info;
    std::shared_ptr<const StoredDictionary> entitlements; // null without any
};
using BundleFactsRef = std::shared_ptr<const BundleFacts>;

} // namespace platform::linux_
