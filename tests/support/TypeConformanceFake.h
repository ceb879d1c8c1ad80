#pragma once

#include "platform/TypeConformance.h"

#include <algorithm>
#include <set>
#include <utility>

namespace support {

/// Types in memory. Unknown ones conform to themselves alone.
class FakeTypeConformance final : public platform::TypeConformance {
public:
    /// From now on `type` is a special case of `super`.
    void declare(const std::string& type, const std::string& super) { _declared.emplace(type, super); }

    bool conforms(std::string_view type, std::string_view super) override {
        return std::ranges::count(supertypes(type), super) > 0;
    }
    std::vector<std::string> supertypes(std::string_view type) override {
        std::vector<std::string> reached{std::string(type)};
        for (std::size_t next = 0; next < reached.size(); ++next)
            for (const auto& [from, to] : _declared)
                if (from == reached[next] && std::ranges::count(reached, to) == 0) reached.push_back(to);
        return reached;
    }

private:
    std::set<std::pair<std::string, std::string>> _declared;
};

} // namespace support
