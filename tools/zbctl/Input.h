#pragma once

#include "platform/PropertyList.h"
#include "tools/zbctl/Session.h"

#include <optional>
#include <string>
#include <variant>
#include <vector>

/// What verbs are told, on the command line and in files. What cannot be used is complained about here, and then none.
namespace zbctl {

/// Relative paths start at the working directory. None for a name that is no UTF-8, which the protocol cannot ask for.
std::optional<std::string> absolutePath(const std::string& path);
std::optional<std::vector<std::string>> absolutePaths(const std::vector<std::string>& paths);

std::optional<platform::UUID> uuidOf(const std::string& text);

/// The dictionary that the file ("-": standard input) holds: a property list of either encoding, or JSON. Markers are
/// expanded.
std::optional<platform::Dictionary> dictionaryOf(const std::string& file);

/// "KEY" stands for true, "KEY=true" and "KEY=false" for booleans, "KEY=TEXT" for a string. The key ends at the first
/// "=".
struct Setting {
    std::string key;
    platform::Value value;
};
std::optional<Setting> settingOf(const std::string& text);

/// Each a UUID, or the path of a bundle, whose UUID the daemon is asked for. The status to end with when that fails.
std::variant<std::vector<platform::UUID>, ExitStatus> uuidsOf(Session& session,
                                                              const std::vector<std::string>& plugIns);

} // namespace zbctl
