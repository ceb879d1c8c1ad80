#include "platform/linux/TypeConformance.h"

#include "platform/SystemLog.h"
#include "platform/linux/DirectoryFiles.h"
#include "platform/linux/FileTrust.h"

#include <algorithm>
#include <cerrno>
#include <utility>

namespace platform::linux_ {

namespace {

constexpr std::size_t maximumFileSize = 16U << 20U; // a hundred thousand types
// Of one type. Real ones have a dozen; without a bound a chain of n types would take n * n / 2 entries.
constexpr std::size_t maximumSupertypes = 1000;

LogHandle& log() { return systemLog().defaultHandle(); }

} // namespace

TypeConformance::TypeConformance(const Root& root) {
    for (const char* directory : {"/usr/share/nordane/types.d", "/etc/nordane/types.d"}) {
        readDirectory(root.at(directory));
    }
    if (_numbers.empty()) log().notice("no content types are known: each conforms to itself alone");
    close();
}

bool TypeConformance::conforms(std::string_view type, std::string_view super) {
    if (type == super) return true;
    const auto from = _numbers.find(type);
    const auto to = _numbers.find(super);
    if (from == _numbers.end() || to == _numbers.end()) return false;
    return std::ranges::binary_search(_supertypes[from->second], to->second);
}

std::vector<std::string> TypeConformance::supertypes(std::string_view type) {
    std::vector<std::string> names{std::string(type)};
    if (const auto known = _numbers.find(type); known != _numbers.end()) {
        for (const Number supertype : _supertypes[known->second]) names.push_back(*_names[supertype]);
    }
    return names;
}

void TypeConformance::readDirectory(const std::string& path) {
    const auto directory = openTrustedDirectory(path);
    if (!directory) {
        if (directory.error().code != ENOENT) log().error("content types not read: %@", directory.error());
        return;
    }
    const auto listing = listDirectory(directory->get());
    if (!listing) return log().error("content types not read: %s", path);
    for (const auto& name : listing->others) {
        if (!name.ends_with(".vlist")) continue;
        const auto table = readTrustedDictionary(directory->get(), name, maximumFileSize);
        if (!table) {
            log().error("content types of %s not read: %@", path, table.error());
        } else if (*table) {
            add(**table);
        }
    }
}

void TypeConformance::add(const Dictionary& table) {
    if (const auto types = table.dictionary("types")) {
        for (const auto& type : *types) {
            const Number number = numberOf(type.name());
            const auto supertypes = type.value.array();
            if (!supertypes) {
                log().error("content type %s: no array of supertypes", type.name());
                continue;
            }
            for (const auto& supertype : *supertypes) {
                const auto name = supertype.string();
                if (!name) continue;
                const Number to = numberOf(*name); // first, for it may move the lists
                _supertypes[number].push_back(to);
            }
        }
    }
    if (const auto aliases = table.dictionary("aliases")) {
        for (const auto& alias : *aliases) {
            const auto type = alias.value.string();
            if (!type) continue;
            // Each conforms to the other, so both have the same super- and subtypes.
            const Number from = numberOf(alias.name());
            const Number to = numberOf(*type);
            _supertypes[from].push_back(to);
            _supertypes[to].push_back(from);
        }
    }
}

TypeConformance::Number TypeConformance::numberOf(std::string_view name) {
    const auto known = _numbers.find(name);
    if (known != _numbers.end()) return known->second;
    const auto added = _numbers.emplace(name, static_cast<Number>(_numbers.size())).first;
    _names.push_back(&added->first);
    _supertypes.emplace_back();
    return added->second;
}

/// Replaces the direct supertypes of each type by all others. A walk from each type, so that cycles need no care.
void TypeConformance::close() {
    std::vector<std::vector<Number>> all(_supertypes.size());
    std::vector<Number> seenFrom(_supertypes.size()); // number + 1 of the type whose walk came here last
    for (Number number = 0; number < all.size(); ++number) {
        auto& found = all[number];
        const Number mark = number + 1;
        seenFrom[number] = mark;
        const auto visit = [&](const std::vector<Number>& supertypes) {
            for (const Number supertype : supertypes) {
                if (std::exchange(seenFrom[supertype], mark) != mark) found.push_back(supertype);
            }
        };
        visit(_supertypes[number]);
        for (std::size_t next = 0; next < found.size() && found.size() < maximumSupertypes; ++next) {
            visit(_supertypes[found[next]]);
        }
        if (found.size() >= maximumSupertypes) log().error("content type %s: too many supertypes", *_names[number]);
        std::ranges::sort(found);
        found.shrink_to_fit();
    }
    _supertypes = std::move(all);
}

} // namespace platform::linux_
