#pragma once

#include "platform/PropertyList.h"

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace platform::linux_ {

/// The table of a bundle's localized manifest keys.
inline constexpr const char* infoTable = "InfoVlist";

/// The languages in which to look for a string, best first: each preferred language followed by its less special
/// forms ("pt-BR", then "pt"), each once.
std::vector<std::string> searchOrder(const std::vector<std::string>& languages);

/// One string table of a bundle, `Resources/<language>/<table>.vlist` in every language that it has. Each key is
/// answered in the best language that has it, so a regional table need hold no more than its differences.
class StringTables {
public:
    /// Reads the files. A `table` that is no plain file name gives an empty table, as does a missing one.
    StringTables(const std::string& bundlePath, const std::string& table, const std::vector<std::string>& searchOrder);

    std::optional<std::string> string(std::string_view key) const;

private:
    std::vector<Dictionary> _tables;
};

} // namespace platform::linux_
