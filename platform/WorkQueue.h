#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>

namespace platform {

enum class QualityOfService { standard, userInitiated };

/// A serial queue: items run one at a time, in the order submitted.
class WorkQueue {
public:
    using Item = std::function<void()>;

    virtual ~WorkQueue() = default;
    WorkQueue(const WorkQueue&) = delete;
    WorkQueue& operator=(const WorkQueue&) = delete;

    /// Runs `item` later on this queue, on some thread of the pool. Callable from any thread, also from the queue
    /// itself. Items still waiting when the last reference goes are run first; the destructor does not wait.
    virtual void async(Item item) = 0;

    /// As `async`, for items that may take microseconds only: on an idle queue a thread of the platform that delivers
    /// events, such as the transport's, may run the item itself once the delivery has returned, which saves a wake-up
    /// that costs as much as the item. It asks `isBrief` when it has come to the item, before it runs it.
    virtual void asyncOnCaller(Item item, std::function<bool()> isBrief) = 0;

    /// Runs `item` now, after everything submitted before it, and returns its result when it is done.
    /// On an idle queue it runs on the caller's thread, at the cost of a lock. Calling it from the queue itself is a
    /// bug and stops the process with the queue's label.
    template <class F> auto sync(F&& item) -> std::invoke_result_t<F&> {
        using R = std::invoke_result_t<F&>;
        if constexpr (std::is_void_v<R>) {
            auto* function = std::addressof(item); // by its address, since the item itself may be const
            runSync(Call{&function, [](void* f) { (**static_cast<std::remove_reference_t<F>**>(f))(); }});
        } else {
            struct Slot {
                std::remove_reference_t<F>* item;
                std::optional<R> result;
            } slot{&item, std::nullopt};
            runSync(
                Call{&slot, [](void* s) { static_cast<Slot*>(s)->result.emplace((*static_cast<Slot*>(s)->item)()); }});
            return std::move(*slot.result);
        }
    }

    /// True on the thread that is running one of this queue's items.
    virtual bool isCurrent() const = 0;

    /// Stops the process with the queue's label unless the caller runs on this queue.
    void assertCurrent() const {
        if (!isCurrent()) failNotCurrent();
    }

    virtual std::string_view label() const = 0;

protected:
    WorkQueue() = default;
    /// A call without allocation: `invoke(context)` is run exactly once, before `runSync` returns.
    struct Call {
        void* context;
        void (*invoke)(void* context);
    };
    virtual void runSync(Call call) = 0;
    [[noreturn]] void failNotCurrent() const;
};

/// Makes queues. They share one pool of threads, which grows while items block.
class WorkQueues {
public:
    virtual ~WorkQueues() = default;
    virtual std::shared_ptr<WorkQueue> makeSerial(std::string label,
                                                  QualityOfService quality = QualityOfService::standard) = 0;
};

} // namespace platform
