#include "platform/linux/SystemLog.h"
#include "tools/zbctl/Options.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <CLI/Config.hpp>
#include <CLI/Formatter.hpp>
#include <algorithm>
#include <array>
#include <csignal>
#include <cstdlib>
#include <string>
#include <vector>

#ifndef ZBD_VERSION
#define ZBD_VERSION "unknown"
#endif

namespace {

/// In the order in which help lists them.
constexpr std::array verbs{
    zbctl::addRegistration, zbctl::addFind,  zbctl::addMatch,   zbctl::addAnnotations, zbctl::addActivation,
    zbctl::addHolds,        zbctl::addWatch, zbctl::addInspect, zbctl::addSign,        zbctl::addRaw,
};

/// The first word that is neither an option nor the value of one.
std::string verbOf(const std::vector<std::string>& words) {
    for (std::size_t i = 0; i < words.size(); ++i) {
        if (words[i] == "--service")
            ++i;
        else if (!words[i].starts_with('-'))
            return words[i];
    }
    return {};
}

/// Takes a command off the end, for the verbs that run one. For the parser, "--" only says that no more options follow.
std::vector<std::string> takeCommand(std::vector<std::string>& words) {
    const auto mark = std::find(words.begin(), words.end(), "--");
    const std::string verb = verbOf(words);
    if ((verb != "hold" && verb != "ready") || mark == words.end()) return {};
    std::vector<std::string> command(mark + 1, words.end());
    words.erase(mark, words.end());
    return command;
}

} // namespace

int main(int argc, char** argv) {
    using zbctl::ExitStatus;
    // The client's own log lines would only stand between a person and the answer.
    if (std::getenv(platform::linux_::logEnvironmentVariable) != nullptr)
        platform::setSystemLog(platform::linux_::SystemLog::ofProcess());
    (void)std::signal(SIGPIPE, SIG_IGN);

    CLI::App app("Asks zbd, the plug-in daemon. Set NORDANE_ROOT to ask the one of a scratch platform.", "zbctl");
    app.set_version_flag("--version", "zbctl " ZBD_VERSION);
    app.require_subcommand(1);
    app.fallthrough();
    app.footer("Exit status: 0 success, 1 an error reply or lost output, 2 wrong usage, 3 no daemon.");

    zbctl::Invocation invocation;
    zbctl::addText(&app, "--service", invocation.service, "Name of the daemon's service")->type_name("NAME");
    app.add_flag("--json", invocation.json, "Print JSON");
    for (const auto add : verbs) add(app, invocation);

    std::vector<std::string> words(argv + 1, argv + argc);
    invocation.command = takeCommand(words);
    std::reverse(words.begin(), words.end()); // as the parser wants them
    try {
        app.parse(std::move(words));
    } catch (const CLI::ParseError& error) {
        invocation.status = app.exit(error) == 0 ? ExitStatus::success : ExitStatus::usage;
    }
    if (!zbctl::flushOutput() && invocation.status == ExitStatus::success) invocation.status = ExitStatus::failure;
    return static_cast<int>(invocation.status);
}
