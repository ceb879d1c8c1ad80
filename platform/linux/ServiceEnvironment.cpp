#include "platform/linux/ServiceEnvironment.h"

#include "platform/linux/DirectoryFiles.h"

#include <algorithm>
#include <cstdlib>
#include <map>

namespace platform::linux_ {

namespace {

/// Passed on: where programs are, the language, the clock, and the scratch platform whose broker answers tokens.
constexpr const char* inheritedVariables[] = {"PATH", "LANG", "TZ", "NORDANE_ROOT"};

constexpr std::string_view reservedPrefixes[] = {"LD_", "NORDANE_"};

/// What the C library itself drops for programs that run with more rights than their caller, and did drop once;
/// except TMPDIR, which is the data container's.
constexpr std::string_view reservedVariables[] = {
    "GCONV_PATH",   "GETCONF_DIR", "GLIBC_TUNABLES", "HOSTALIASES", "LOCALDOMAIN",      "LOCPATH",   "MALLOC_CHECK_",
    "MALLOC_TRACE", "NIS_PATH",    "NLSPATH",        "RES_OPTIONS", "RESOLV_HOST_CONF", "SHELLOPTS", "TZDIR",
};

/// As much of a hostile name or value as an error line needs.
std::string shown(std::string_view text) { return Value(text.substr(0, 64)).description(); }

} // namespace

bool isReservedVariable(std::string_view name) {
    return std::ranges::any_of(reservedPrefixes, [&](auto prefix) { return name.starts_with(prefix); }) ||
           std::ranges::find(reservedVariables, name) != std::end(reservedVariables);
}

std::variant<ServiceDescription, std::string> readServiceDescription(const Dictionary& overlay) {
    const auto service = overlay.dictionary("QMXService");
    if (!service) return "the overlay has no \"QMXService\" dictionary";
    if (overlay.string("VBBundlePackageType") != "QMX!") return "the overlay is not of package type \"QMX!\"";

    ServiceDescription description;
    const auto profile = service->string("_SandboxProfile");
    if (!profile) return "\"_SandboxProfile\" is no string";
    description.profile = findConfinementProfile(*profile);
    if (description.profile == nullptr) return "there is no sandbox profile \"" + shown(*profile) + '"';

    const Value given = (*service)["EnvironmentVariables"];
    const auto variables = given.dictionary();
    if (given && !variables) return "\"EnvironmentVariables\" is no dictionary";
    for (const auto& entry : variables.value_or(Dictionary())) {
        const auto name = entry.name();
        const auto value = entry.value.string();
        if (name.empty() || name.find('=') != std::string_view::npos) {
            return "no environment variable can be named \"" + shown(name) + '"';
        }
        if (!value) return "the environment variable \"" + shown(name) + "\" is no string";
        if (isReservedVariable(name)) {
            description.dropped.push_back(shown(name));
        } else {
            description.variables.emplace_back(name, *value);
        }
    }
    return description;
}

std::vector<std::string> serviceEnvironment(const ServiceDescription& service, const std::string& managersContainer,
                                            const std::string& container) {
    std::map<std::string, std::string> variables;
    for (const char* name : inheritedVariables) {
        if (const char* value = std::getenv(name)) variables[name] = value;
    }
    for (const auto& [name, value] : service.variables) {
        variables[name] =
            isAtOrBelow(value, managersContainer) ? container + value.substr(managersContainer.size()) : value;
    }
    std::vector<std::string> environment;
    environment.reserve(variables.size());
    for (const auto& [name, value] : variables) environment.push_back(name + '=' + value);
    return environment;
}

} // namespace platform::linux_
