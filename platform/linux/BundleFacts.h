#pragma once

#include "platform/PropertyList.h"

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>

namespace platform::linux_ {

/// Makes dictionaries hold the same key only once: all manifests have the same few, and in one after another they
/// would take more memory than the values. Any thread.
class SharedKeys {
public:
    /// An equal dictionary.
    Dictionary share(const Dictionary& dictionary);

private:
    std::mutex _mutex;
    std::unordered_map<std::string_view, Value> _keys; // each under the text that it holds
};

/// A dictionary that came from the database, in its compact encoding until somebody asks for it: most manifests of a
/// start are never looked at. Any thread.
class StoredDictionary {
public:
    // `keys` must outlive this.
    StoredDictionary(const Dictionary& dictionary, SharedKeys& keys);
    StoredDictionary(std::string encoded, SharedKeys& keys) : _keys(keys), _encoded(std::move(encoded)) {}

    /// Empty when the stored bytes are damaged.
    const Dictionary& dictionary() const;
    /// The compact encoding.
    std::string encoded() const;

private:
    SharedKeys& _keys;
    mutable std::once_flag _decoding;
    mutable std::string _encoded; // given up when it is decoded
    mutable Dictionary _dictionary;
};

/// Which directory it is: a directory that was replaced differs also when the new one got the old inode number.
struct FileIdentity {
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    std::int64_t birth = 0; // nanoseconds since 1970; 0 where the file system keeps none
    friend bool operator==(const FileIdentity&, const FileIdentity&) = default;
};

/// What the registry keeps of one bundle directory. Immutable but for `evidence`.
struct BundleFacts {
    FileIdentity identity;
    /// A digest of the states (inode, size, times) of every file that was read. While the files still give the same
    /// digest, nothing needs to be read again. 0: read again in any case. For the registry's own thread only.
    mutable std::uint64_t evidence = 0;
    std::uint64_t fingerprint = 0; // a digest of the content: manifest, entitlements, string tables
    bool hasResources = false;     // most bundles have none, and need no look for localized names
    std::string executable;        // its file name; empty without one, and for applications, whose program is not read
    std::shared_ptr<const StoredDictionary> info;
    std::shared_ptr<const StoredDictionary> entitlements; // null without any
};
using BundleFactsRef = std::shared_ptr<const BundleFacts>;

} // namespace platform::linux_
