#include "Zembra/ZBProtocol.h"
#include "platform/linux/Notifications.h"
#include "platform/linux/UserDirectory.h"
#include "tools/zbctl/Options.h"
#include "tools/zbctl/Output.h"
#include "tools/zbctl/Verbs.h"

#include <condition_variable>
#include <iostream>
#include <memory>
#include <mutex>

namespace zbctl {

namespace {

/// Outlives the observation: a notification may be under way when the last one that counts has come.
struct Arrivals {
    std::mutex mutex;
    std::condition_variable changed;
    std::uint64_t count = 0;
};

/// A line per notification. Ends after `count` of them, or never.
ExitStatus watch(const std::string& name, std::optional<std::uint64_t> count) {
    if (platform::linux_::pathComponentError(name) != 0) {
        complain('"' + name + "\" is not the name of a notification");
        return ExitStatus::usage;
    }
    platform::linux_::WorkQueues queues;
    platform::linux_::Notifications notifications(platform::linux_::Root::ofProcess());
    const auto arrivals = std::make_shared<Arrivals>();
    const auto observation =
        notifications.observe(name, queues.makeSerial("watch", platform::QualityOfService::standard), [arrivals] {
            const std::lock_guard lock(arrivals->mutex);
            ++arrivals->count;
            arrivals->changed.notify_one();
        });
    // Whoever started this may now cause what is to be seen.
    std::cerr << "watching " << printable(name) << '\n' << std::flush;

    std::unique_lock lock(arrivals->mutex);
    for (std::uint64_t seen = 0; !count || seen < *count;) {
        arrivals->changed.wait(lock, [&] { return arrivals->count > seen; });
        ++seen;
        std::cout << printable(name) << '\n' << std::flush;
        if (!std::cout) return ExitStatus::failure;
    }
    return ExitStatus::success;
}

} // namespace

void addWatch(CLI::App& app, Invocation& invocation) {
    auto* verb = app.add_subcommand("watch", "Print a line for each notification");
    const auto name = std::make_shared<std::string>(zembra::annotationChangeNotification);
    const auto count = std::make_shared<std::optional<std::uint64_t>>();
    verb->add_option("NAME", *name, "The notification")->capture_default_str();
    addNumber(verb, "--count", [=](std::uint64_t number) { *count = number; }, "End after so many");
    verb->callback([=, &invocation] { invocation.status = watch(*name, *count); });
}

} // namespace zbctl
