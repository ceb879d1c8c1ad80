#pragma once

#include "tools/zbctl/Session.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

/// What zbctl does, a function per verb. Each prints its result on standard output and its troubles on standard error.
namespace zbctl {

struct Common {
    std::optional<std::string> service;
    bool json = false;
};

/// Relative paths start at the working directory.
enum class Registration { add, remove };
ExitStatus changeRegistration(const Common& common, Registration registration, const std::vector<std::string>& paths);

ExitStatus bulk(const Common& common, std::uint64_t flags);

/// One of them is given.
struct Location {
    std::optional<std::string> uuid;
    std::optional<std::string> url;
    std::optional<std::string> path;
};
ExitStatus find(const Common& common, const Location& location);

/// Sends what the file ("-": standard input) holds, as it stands: a property list of either encoding, or JSON.
/// Prints the reply, also one that reports an error.
ExitStatus raw(const Common& common, const std::string& file);

struct Signing {
    std::string file;
    std::optional<std::string> entitlements; // a property-list file
    std::vector<std::string> settings;       // KEY or KEY=VALUE
    bool show = false;
    bool remove = false;
};
ExitStatus sign(const Common& common, const Signing& signing);

/// A line per notification. Ends after `count` of them, or never.
ExitStatus watch(const std::string& name, std::optional<std::uint64_t> count);

} // namespace zbctl
