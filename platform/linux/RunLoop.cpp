#include "platform/linux/RunLoop.h"

#include <array>
#include <cerrno>
#include <condition_variable>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <mutex>
#include <pthread.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <thread>
#include <unistd.h>

namespace platform::linux_ {

namespace {

constexpr std::uint64_t mainQueueKey = 0;

/// Without its descriptors the process would never hear of its end.
int require(int result, const char* what) {
    if (result >= 0) return result;
    std::perror(what);
    std::abort();
}

void watch(int epoll, int descriptor, std::uint64_t key) {
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.u64 = key;
    require(::epoll_ctl(epoll, EPOLL_CTL_ADD, descriptor, &event), "epoll_ctl");
}

} // namespace

/// The queue whose items run on the main thread.
class MainQueue final : public WorkQueue {
public:
    MainQueue() : _event(require(::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC), "eventfd")) {}

    void async(Item item) override {
        bool wasEmpty;
        {
            const std::lock_guard guard(_lock);
            wasEmpty = _line.empty();
            _line.push_back(std::move(item));
        }
        if (!wasEmpty) return; // the loop has been told
        constexpr std::uint64_t one = 1;
        // Cannot fail: the counter is far from its end.
        (void)!::write(_event.get(), &one, sizeof one);
    }

    void asyncOnCaller(Item item, std::function<bool()> /*isBrief*/) override { async(std::move(item)); }

    bool isCurrent() const override { return std::this_thread::get_id() == _mainThread && _isRunning; }

    std::string_view label() const override { return "main"; }

    int descriptor() const { return _event.get(); }

    /// Runs what is waiting now; what comes meanwhile waits for the next round, so that signals are heard between.
    void runWaiting() {
        std::uint64_t count = 0;
        (void)!::read(_event.get(), &count, sizeof count); // empty after a `sync` of the main thread
        std::deque<Item> line;
        {
            const std::lock_guard guard(_lock);
            line.swap(_line);
        }
        for (Item& item : line) {
            runNow(item);
            item = nullptr;
        }
    }

    template <class F> void runNow(F& item) noexcept {
        _isRunning = true;
        item();
        _isRunning = false;
    }

private:
    void runSync(Call call) override {
        if (isCurrent()) {
            std::fputs("work queue \"main\" is entered from itself\n", stderr);
            std::abort();
        }
        if (std::this_thread::get_id() == _mainThread) {
            runWaiting();
            auto item = [&] { call.invoke(call.context); };
            runNow(item);
            return;
        }
        std::mutex lock;
        std::condition_variable wakeUp;
        bool isDone = false;
        async([&] {
            call.invoke(call.context);
            const std::lock_guard guard(lock);
            isDone = true;
            wakeUp.notify_one();
        });
        std::unique_lock guard(lock);
        wakeUp.wait(guard, [&] { return isDone; });
    }

    const std::thread::id _mainThread = std::this_thread::get_id();
    const Descriptor _event;
    bool _isRunning = false; // main thread only

    std::mutex _lock;
    std::deque<Item> _line; // guarded by the lock
};

class RunLoop::SignalSource final : public platform::SignalSource {
public:
    SignalSource(RunLoop& loop, std::uint64_t key, int signal, std::function<void()> handler)
        : _loop(loop), _key(key), _handler(std::make_shared<std::function<void()>>(std::move(handler))) {
        sigset_t signals;
        sigemptyset(&signals);
        sigaddset(&signals, signal);
        // Blocked from now on, so that it waits in the kernel until there is somebody to hear it.
        pthread_sigmask(SIG_BLOCK, &signals, nullptr);
        _descriptor.reset(require(::signalfd(-1, &signals, SFD_NONBLOCK | SFD_CLOEXEC), "signalfd"));
    }

    ~SignalSource() override {
        if (_isActive) _loop.remove(_key, _descriptor.get());
    }

    void activate() override {
        if (_isActive) return;
        _isActive = true;
        _loop.add(_key, *this, _descriptor.get());
    }

    void deliver() {
        signalfd_siginfo info;
        if (::read(_descriptor.get(), &info, sizeof info) != sizeof info) return;
        const auto handler = _handler; // it may destroy this source
        _loop._mainQueue->runNow(*handler);
    }

private:
    RunLoop& _loop;
    const std::uint64_t _key;
    const std::shared_ptr<std::function<void()>> _handler;
    Descriptor _descriptor;
    bool _isActive = false;
};

RunLoop::RunLoop()
    : _epoll(require(::epoll_create1(EPOLL_CLOEXEC), "epoll_create1")), _mainQueue(std::make_shared<MainQueue>()) {
    watch(_epoll.get(), _mainQueue->descriptor(), mainQueueKey);
}

RunLoop::~RunLoop() = default;

void RunLoop::run() {
    runUntil([] { return false; });
}

void RunLoop::runUntil(const std::function<bool()>& isDone) {
    while (!isDone()) {
        std::array<epoll_event, 8> events;
        const int count = ::epoll_wait(_epoll.get(), events.data(), events.size(), -1);
        if (count < 0 && errno == EINTR) continue;
        require(count, "epoll_wait");
        for (int i = 0; i < count; ++i) {
            const std::uint64_t key = events[static_cast<std::size_t>(i)].data.u64;
            if (key == mainQueueKey)
                _mainQueue->runWaiting();
            else if (const auto source = _sources.find(key); source != _sources.end())
                source->second->deliver();
        }
    }
}

std::shared_ptr<WorkQueue> RunLoop::mainQueue() { return _mainQueue; }

std::unique_ptr<platform::SignalSource> RunLoop::makeSignalSource(int signal, std::function<void()> handler) {
    return std::make_unique<SignalSource>(*this, ++_lastKey, signal, std::move(handler));
}

void RunLoop::add(std::uint64_t key, SignalSource& source, int descriptor) {
    watch(_epoll.get(), descriptor, key);
    _sources[key] = &source;
}

void RunLoop::remove(std::uint64_t key, int descriptor) {
    ::epoll_ctl(_epoll.get(), EPOLL_CTL_DEL, descriptor, nullptr);
    _sources.erase(key);
}

} // namespace platform::linux_
