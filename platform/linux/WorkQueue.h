#pragma once

#include "platform/WorkQueue.h"

#include <cstddef>
#include <memory>
#include <string>

namespace platform::linux_ {

class ThreadPool;

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
