#include "platform/linux/Root.h"
#include "platform/linux/ServiceLaunch.h"
#include "platform/linux/SystemLog.h"

#include <cstdio>
#include <string>
#include <vector>

#ifndef ZBD_VERSION
#define ZBD_VERSION "unknown"
#endif

namespace {

constexpr const char* help =
    "usage: zbignite EXECUTABLE|IDENTIFIER [ARGUMENT...]\n"
    "\n"
    "Becomes the plug-in that was made ready for the process that started it: confined, with the environment that the\n"
    "plug-in was given. EXECUTABLE is the path of the plug-in's program, IDENTIFIER its bundle identifier. The plug-in\n"
    "keeps standard input, output and error, and starts in its data container. Set NORDANE_ROOT for a scratch platform.\n"
    "\n"
    "  --help     show this\n"
    "  --version  show the version\n"
    "\n"
    "Exit status: that of the plug-in; or 120 wrong usage, 121 no service manager, 122 not registered for this host,\n"
    "123 refused, 124 the plug-in cannot be confined, 125 it cannot be executed.\n"
    "\n"
    "NORDANE_ALLOW_UNCONFINED in the environment starts plug-ins also on kernels without Landlock. For development.\n";

} // namespace

int main(int argc, char** argv) {
    using platform::linux_::LaunchStatus;
    const std::vector<std::string> words(argv + (argc > 0 ? 1 : 0), argv + argc);
    const std::string first = words.empty() ? "" : words.front();
    if (first == "--help") return std::fputs(help, stdout) < 0 || std::fflush(stdout) != 0;
    if (first == "--version") return std::puts("zbignite " ZBD_VERSION) < 0 || std::fflush(stdout) != 0;
    // What follows the name belongs to the plug-in, so there is nothing else to parse.
    if (first.empty() || first.starts_with('-')) {
        std::fputs(help, stderr);
        return static_cast<int>(LaunchStatus::usage);
    }
    platform::setSystemLog(platform::linux_::SystemLog::ofProcess());
    const auto refusal = platform::linux_::becomeService(platform::linux_::Root::ofProcess(), words.front(),
                                                         {words.begin() + 1, words.end()});
    std::fprintf(stderr, "zbignite: %s\n", refusal.reason.c_str());
    return static_cast<int>(refusal.status);
}
