#pragma once

#include "platform/WorkQueue.h"

#include <cstddef>
#include <memory>
#include <string>
#include <vector>

namespace platform::linux_ {

class ThreadPool;

class Queue;

/// Makes the calling thread one of those that serve queues, for as long as this object lives: what the thread submits
/// with `asyncOnCaller` to idle queues it runs itself, at its next `serve`. For a thread's outermost loop: nothing that
/// it calls there holds a lock or is on a queue. Goes before the queues do.
class LentThread {
public:
    LentThread();
    ~LentThread();
    LentThread(const LentThread&) = delete;
    LentThread& operator=(const LentThread&) = delete;

    /// Runs what the queues taken since the last call have waiting, or, of many items, the first few.
    void serve() {
        if (!_taken.empty()) serveTaken();
    }

private:
    friend class Queue;
    void serveTaken();
    /// Leaves the queues to the pool, before the thread waits for one of them.
    void giveBack();

    std::vector<std::shared_ptr<Queue>> _taken; // whose turn this thread has, and has not begun
};

/// Serial queues on one pool of threads.
///
/// A queue is a turn that passes from item to item. An idle queue gives its turn to whoever asks; `sync` then runs its
/// item in place. On a busy queue the turn goes to the next in line: to a thread that waits in `sync`, which runs its
/// item itself, or to the pool.
class WorkQueues final : public platform::WorkQueues {
public:
    /// Far more than there are queues that wait for something; past it, queues wait for a thread.
    static constexpr std::size_t defaultMaximumThreads = 512;

    explicit WorkQueues(std::size_t maximumThreads = defaultMaximumThreads);
    /// Returns when all items have run, those submitted meanwhile too. Not to be called on the pool's own threads.
    /// What is submitted to a queue afterwards does not run.
    ~WorkQueues() override;

    std::shared_ptr<WorkQueue> makeSerial(std::string label, QualityOfService quality) override;

private:
    std::shared_ptr<ThreadPool> _pool;
};

} // namespace platform::linux_
