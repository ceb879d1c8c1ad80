#include "platform/linux/WorkQueue.h"

#include "platform/linux/ServiceThread.h"

#include <array>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <malloc.h>
#include <mutex>
#include <sys/resource.h>
#include <utility>

namespace platform {

void WorkQueue::failNotCurrent() const {
    const std::string name(label());
    std::fprintf(stderr, "not on work queue \"%s\"\n", name.c_str());
    std::abort();
}

namespace linux_ {

namespace {

// A thread that finds nothing to do waits that long for more before it ends.
constexpr std::chrono::seconds idleTime{10};

// So many items of one queue run on a pool thread before other queues have theirs.
constexpr std::size_t poolBatch = 64;

// Pages that a turn takes from the system before it is worth the milliseconds to give them back. Answers of a thousand
// plug-ins stay below.
constexpr long manyPages = 4096;

long pagesTaken() {
    rusage usage{};
    getrusage(RUSAGE_THREAD, &usage);
    return usage.ru_minflt;
}

// A thread that is lent runs no more items than this of a queue at once: it has other work to return to.
constexpr std::size_t lentBatch = 16;

/// Names the calling thread: an address no other living thread has.
const void* thisThread() {
    static thread_local const char mark = 0;
    return &mark;
}

} // namespace

/// Threads that run what is left in queues. One always stands ready; more are made when a queue has items and no
/// thread is free, since busy ones may all be waiting for that very queue.
class ThreadPool : public std::enable_shared_from_this<ThreadPool> {
public:
    explicit ThreadPool(std::size_t maximumThreads) : _maximumThreads(maximumThreads) {}

    void start() {
        const std::lock_guard guard(_lock);
        startThread();
        if (_threads == 0) {
            std::fputs("cannot start a thread for work queues\n", stderr);
            std::abort();
        }
    }

    /// Calls the queue's `runTurn` on some thread.
    void submit(std::shared_ptr<Queue> queue, QualityOfService quality);

    void stop() {
        std::unique_lock lock(_lock);
        _isStopping = true;
        _wakeUp.notify_all();
        _ended.wait(lock, [this] { return _threads == 0; });
    }

private:
    // Called with the lock held.
    void startThread();
    std::shared_ptr<Queue> takeReady();

    void runThread();

    const std::size_t _maximumThreads;
    std::mutex _lock; // guards what follows
    std::condition_variable _wakeUp;
    std::condition_variable _ended;
    std::array<std::deque<std::shared_ptr<Queue>>, 2> _ready; // user-initiated queues first
    std::size_t _threads = 0;
    std::size_t _idleThreads = 0;
    bool _isStopping = false;
};

namespace {

/// Where the calling thread is lent.
thread_local LentThread* lentThread = nullptr;

} // namespace

class Queue final : public WorkQueue, public std::enable_shared_from_this<Queue> {
public:
    Queue(std::string label, QualityOfService quality, std::shared_ptr<ThreadPool> pool)
        : _label(std::move(label)), _quality(quality), _pool(std::move(pool)) {}

    void async(Item item) override {
        if (enqueue({std::move(item), nullptr, nullptr})) leaveToPool();
    }

    void asyncOnCaller(Item item, std::function<bool()> isBrief) override {
        if (!enqueue({std::move(item), nullptr, std::move(isBrief)})) return;
        if (lentThread != nullptr) {
            lentThread->_taken.push_back(shared_from_this());
        } else {
            leaveToPool();
        }
    }

    /// The caller has the turn.
    void leaveToPool() { _pool->submit(shared_from_this(), _quality); }

    /// Runs waiting items. The caller has the turn, and has passed it on or given it up on return.
    void runTurn(std::size_t limit = poolBatch, bool isLent = false) {
        for (std::size_t count = 0; count < limit; ++count) {
            if (isLent && !isNextBrief()) break;
            Item item;
            {
                const std::lock_guard guard(_lock);
                if (!takeNext(item)) return;
            }
            runItem(item);
        }
        passTurn();
    }

    bool isCurrent() const override { return _runner.load(std::memory_order_relaxed) == thisThread(); }

    std::string_view label() const override { return _label; }

private:
    /// A thread inside `sync`, waiting for the turn.
    struct Waiter {
        std::condition_variable granted;
        bool isGranted = false;
    };
    struct Entry {
        Item item;
        Waiter* waiter; // instead of an item
        std::function<bool()> isBrief;
    };

    /// True when the queue was idle and the turn is the caller's now.
    bool enqueue(Entry entry) {
        const std::lock_guard guard(_lock);
        _line.push_back(std::move(entry));
        return !std::exchange(_isTaken, true);
    }

    void runSync(Call call) override {
        if (isCurrent()) {
            std::fprintf(stderr, "work queue \"%s\" is entered from itself\n", _label.c_str());
            std::abort();
        }
        if (lentThread != nullptr) lentThread->giveBack();
        {
            std::unique_lock lock(_lock);
            if (_isTaken) {
                Waiter waiter;
                _line.push_back({nullptr, &waiter, nullptr});
                waiter.granted.wait(lock, [&] { return waiter.isGranted; });
            } else {
                _isTaken = true;
            }
        }
        // Passed on also when the item throws, which is then the caller's to handle.
        struct Turn {
            Queue& queue;
            ~Turn() {
                queue._runner.store(nullptr, std::memory_order_relaxed);
                queue.passTurn();
            }
        } turn{*this};
        _runner.store(thisThread(), std::memory_order_relaxed);
        call.invoke(call.context);
    }

    /// The caller has the turn, so the front of the line stays where it is while others join at the end.
    bool isNextBrief() {
        const Entry* next = nullptr;
        {
            const std::lock_guard guard(_lock);
            if (_line.empty()) return true; // nothing is
            next = &_line.front();
        }
        return next->isBrief && next->isBrief();
    }

    void runItem(Item& item) noexcept {
        _runner.store(thisThread(), std::memory_order_relaxed);
        item();
        item = nullptr; // what it holds goes while the queue is still its own
        _runner.store(nullptr, std::memory_order_relaxed);
    }

    /// Gives the turn up when nobody waits, or hands it to a waiting thread or to the pool.
    void passTurn() {
        {
            const std::lock_guard guard(_lock);
            if (_line.empty() || _line.front().waiter) {
                Item none;
                takeNext(none);
                return;
            }
        }
        leaveToPool();
    }

    /// With the lock held: the next item, for the caller to run. False when the turn went elsewhere.
    bool takeNext(Item& item) {
        if (_line.empty()) {
            _isTaken = false;
            return false;
        }
        Entry next = std::move(_line.front());
        _line.pop_front();
        if (next.waiter) {
            // Told under the lock: the waiter is gone as soon as its thread has seen this.
            next.waiter->isGranted = true;
            next.waiter->granted.notify_one();
            return false;
        }
        item = std::move(next.item);
        return true;
    }

    const std::string _label;
    const QualityOfService _quality;
    const std::shared_ptr<ThreadPool> _pool;

    // The thread that runs an item now. Each thread need only tell itself from others, so the order is no matter.
    std::atomic<const void*> _runner = nullptr;

    std::mutex _lock;      // guards what follows
    bool _isTaken = false; // somebody has the turn, or the pool is about to
    std::deque<Entry> _line;
};

LentThread::LentThread() { lentThread = this; }

LentThread::~LentThread() {
    lentThread = nullptr;
    giveBack();
}

void LentThread::serveTaken() {
    for (std::size_t left = _taken.size(); left > 0 && !_taken.empty(); --left) {
        const std::shared_ptr<Queue> next = std::move(_taken.front());
        _taken.erase(_taken.begin());
        next->runTurn(lentBatch, true);
    }
    giveBack(); // what the items submitted is for other threads: this one is wanted back
}

void LentThread::giveBack() {
    for (const auto& taken : _taken) taken->leaveToPool();
    _taken.clear();
}

void ThreadPool::submit(std::shared_ptr<Queue> queue, QualityOfService quality) {
    {
        const std::lock_guard guard(_lock);
        if (_isStopping && _threads == 0) return; // too late: what the item works on may be gone
        _ready[quality == QualityOfService::userInitiated ? 0 : 1].push_back(std::move(queue));
        // A thread that was woken counts as idle until it has taken its queue, hence the comparison of numbers.
        if (_ready[0].size() + _ready[1].size() > _idleThreads) startThread();
    }
    _wakeUp.notify_one(); // whom the lock would only keep waiting
}

void ThreadPool::startThread() {
    if (_threads == _maximumThreads) return;
    ++_threads;
    auto thread = startServiceThread("zbd-work", [self = shared_from_this()] { self->runThread(); });
    if (thread)
        thread->detach();
    else
        --_threads; // the threads there are will come to it
}

std::shared_ptr<Queue> ThreadPool::takeReady() {
    for (auto& queues : _ready) {
        if (queues.empty()) continue;
        std::shared_ptr<Queue> queue = std::move(queues.front());
        queues.pop_front();
        return queue;
    }
    return nullptr;
}

void ThreadPool::runThread() {
    std::unique_lock lock(_lock);
    for (;;) {
        if (std::shared_ptr<Queue> queue = takeReady()) {
            lock.unlock();
            const long pages = pagesTaken();
            queue->runTurn();
            queue.reset(); // may be the last reference
            // What lies free between things that stay is not given back by itself.
            if (pagesTaken() - pages > manyPages) malloc_trim(0);
            lock.lock();
            continue;
        }
        if (_isStopping) break;
        ++_idleThreads;
        const bool isTold = _wakeUp.wait_for(lock, idleTime) == std::cv_status::no_timeout;
        --_idleThreads;
        if (!isTold && _threads > 1 && _ready[0].empty() && _ready[1].empty()) break;
    }
    --_threads;
    if (_threads == 0) _ended.notify_all();
}

WorkQueues::WorkQueues(std::size_t maximumThreads) : _pool(std::make_shared<ThreadPool>(maximumThreads)) {
    _pool->start();
}

WorkQueues::~WorkQueues() { _pool->stop(); }

std::shared_ptr<WorkQueue> WorkQueues::makeSerial(std::string label, QualityOfService quality) {
    return std::make_shared<Queue>(std::move(label), quality, _pool);
}

} // namespace linux_

} // namespace platform
