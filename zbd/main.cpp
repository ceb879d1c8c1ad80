#include "Zembra/ZBLog.h"
#include "Zembra/ZBProtocol.h"
#include "platform/linux/LinuxPlatform.h"
#include "zbd/ZBDServer.h"

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <string>
#include <unistd.h>

namespace {

namespace log = zembra::log;

constexpr int exitNoServer = 1;
constexpr int exitUsage = 2;

struct Options {
    std::uint32_t cacheLimit = zbd::ZBDatabase::defaultCacheLimit;
    std::optional<std::string> database;
    std::string service = zembra::serviceName;
    std::uint32_t verbose = 0;
};

/// None after a wrong command line.
std::optional<Options> parse(int argc, char** argv) {
    Options options;
    int letter = 0;
    // The plus sign lets the first operand end the options, whatever the environment says.
    while ((letter = getopt(argc, argv, "+c:d:S:v")) != -1) {
        switch (letter) {
        // Leading digits count and anything else is 0, as administrators know it.
        // NOLINTNEXTLINE(cert-err34-c)
        case 'c': options.cacheLimit = static_cast<std::uint32_t>(std::atoi(optarg)); break;
        case 'd': options.database = optarg; break;
        case 'S': options.service = optarg; break;
        case 'v':
            ++options.verbose;
            platform::systemLog().defaultHandle().error(
                "verbose option -v is ineffective; use log config --subsystem com.nordane.zembra");
            break;
        default: return std::nullopt;
        }
    }
    return optind == argc ? std::optional(options) : std::nullopt;
}

/// Ends the process without exit handlers: those of libraries take away what other threads are still using.
[[noreturn]] void end(platform::linux_::LinuxPlatform& services, int status) {
    services.leave();
    std::_Exit(status);
}

} // namespace

int main(int argc, char** argv) {
    // Never destroyed: the process ends inside the run loop, while other threads still run.
    static auto& services = *new platform::linux_::LinuxPlatform;
    log::ops().info("zbd is launching");
    const auto options = parse(argc, argv);
    if (!options) {
        static_cast<void>(std::fputs("Usage: zbd [-S servicename] [-v]\n", stderr));
        return exitUsage;
    }
    platform::Platform& platform = services.start();
    const auto server = zbd::ZBDServer::initForService(platform, options->service, options->database);
    if (!server) {
        log::ops().error("unable to construct server");
        end(services, exitNoServer);
    }
    server->setVerbose(options->verbose);
    server->setCacheLimit(options->cacheLimit);
    const auto terminate = platform.runLoop.makeSignalSource(SIGTERM, [&server] {
        server->stop();
        end(services, EXIT_SUCCESS);
    });
    terminate->activate();
    server->run();
}
