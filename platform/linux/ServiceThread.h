#pragma once

#include <csignal>
#include <optional>
#include <pthread.h>
#include <system_error>
#include <thread>
#include <utility>

namespace platform::linux_ {

/// Starts a thread that takes no signals: those belong to the main run loop. `name` (15 bytes at the most) is seen in
/// debuggers. None when the system has no thread left.
template <class F> std::optional<std::thread> startServiceThread(const char* name, F&& body) {
    sigset_t all;
    sigset_t before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before); // inherited, so that there is no moment with signals open
    std::optional<std::thread> thread;
    try {
        thread.emplace(std::forward<F>(body));
        pthread_setname_np(thread->native_handle(), name);
    } catch (const std::system_error&) {
        thread.reset();
    }
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return thread;
}

} // namespace platform::linux_
