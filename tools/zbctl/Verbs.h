#pragma once

#include "tools/zbctl/Session.h"

#include <CLI/App.hpp>
#include <optional>
#include <string>
#include <vector>

/// What zbctl does. Each verb prints its result on standard output and its troubles on standard error.
namespace zbctl {

/// One run of the program: what stands before and behind the verb's own words, and how it ends.
struct Invocation {
    std::optional<std::string> service;
    bool json = false;
    std::vector<std::string> command; // behind "--"; of "hold" and "ready" only
    ExitStatus status = ExitStatus::success;
};

// Each adds its verbs to the command line. They run while it is parsed, at most one of them, and leave their status in
// `invocation`, which must outlive `app`.

/// "add", "remove" and "bulk".
void addRegistration(CLI::App& app, Invocation& invocation);
void addFind(CLI::App& app, Invocation& invocation);
void addMatch(CLI::App& app, Invocation& invocation);
/// "annotate", "elect" and "bulk-annotate".
void addAnnotations(CLI::App& app, Invocation& invocation);
/// "ready" and "access".
void addActivation(CLI::App& app, Invocation& invocation);
/// "hold" and "release".
void addHolds(CLI::App& app, Invocation& invocation);
void addWatch(CLI::App& app, Invocation& invocation);
void addInspect(CLI::App& app, Invocation& invocation);
void addSign(CLI::App& app, Invocation& invocation);
void addRaw(CLI::App& app, Invocation& invocation);

} // namespace zbctl
