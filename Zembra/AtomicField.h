#pragma once

#include <atomic>
#include <thread>
#include <utility>

namespace zembra {

/// A field that is read and replaced whole, from any thread: a reader gets the old or the new value and keeps it alive.
/// The lock is one byte, because a record has a dozen such fields and thousands of records are kept; it is held for a
/// copy, a test or a swap only.
template <class T> class AtomicField {
public:
    AtomicField() = default;
    explicit AtomicField(T value) : _value(std::move(value)) {}
    AtomicField(const AtomicField&) = delete;
    AtomicField& operator=(const AtomicField&) = delete;

    T get() const {
        const Guard guard(_locked);
        return _value;
    }

    /// What `look` answers about the value, with the lock held: for a part of it, or a test. `look` must not use the
    /// field.
    template <class F> auto read(F&& look) const {
        const Guard guard(_locked);
        return look(_value);
    }

    /// The value replaced dies outside the lock, so its destructor may do anything.
    void set(T value) {
        const Guard guard(_locked);
        std::swap(_value, value);
    }

private:
    class Guard {
    public:
        explicit Guard(std::atomic_flag& locked) : _flag(locked) {
            // The holder is done in a moment. To wake somebody who waits in the kernel would cost each holder more
            // than what it holds the lock for.
            while (_flag.test_and_set(std::memory_order_acquire)) std::this_thread::yield();
        }
        ~Guard() { _flag.clear(std::memory_order_release); }
        Guard(const Guard&) = delete;
        Guard& operator=(const Guard&) = delete;

    private:
        std::atomic_flag& _flag;
    };

    mutable std::atomic_flag _locked;
    T _value{};
};

} // namespace zembra
