#pragma once

#include "platform/PropertyList.h"
#include "platform/TypeConformance.h"
#include "platform/linux/Root.h"

#include <cstdint>
#include <functional>
#include <string>
#include <unordered_map>
#include <vector>

namespace platform::linux_ {

/// A table of types, read once at construction from every `*.vlist` in `<root>/usr/share/nordane/types.d`, which comes
/// with the system, and `<root>/etc/nordane/types.d`, the administrator's. Each is a dictionary with the optional
/// entries "types" (from a type to an array of its direct supertypes) and "aliases" (from another name of a type to the
/// type). What several files say of one type adds up. Names compare exactly. Files and directories that others than
/// the superuser and this process's user can write are refused. Any thread.
class TypeConformance final : public platform::TypeConformance {
public:
    /// Logs what cannot be read, and when nothing is known; the rest counts.
    explicit TypeConformance(const Root& root);

    /// Two look-ups by hash and a binary search among all supertypes of `type`.
    bool conforms(std::string_view type, std::string_view super) override;
    std::vector<std::string> supertypes(std::string_view type) override;

private:
    using Number = std::uint32_t;
    struct Hash {
        using is_transparent = void;
        std::size_t operator()(std::string_view name) const { return std::hash<std::string_view>()(name); }
    };

    void readDirectory(const std::string& path);
    void add(const Dictionary& table);
    Number numberOf(std::string_view name);
    void close();

    std::unordered_map<std::string, Number, Hash, std::equal_to<>> _numbers;
    std::vector<const std::string*> _names;       // by number: the keys above
    std::vector<std::vector<Number>> _supertypes; // by number: the direct ones while reading, then all, sorted
};

} // namespace platform::linux_
