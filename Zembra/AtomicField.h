#pragma once

#include <atomic>
#include <utility>

namespace zembra {

/// A field that is read and replaced whole, from any thread: a reader gets the old or the new value and keeps it alive.
/// The lock is one byte, because a record has a dozen such fields and thousands of records are kept; it is held for a
/// copy or a swap only.
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

    /// The value replaced dies outside the lock, so its destructor may do anything.
    void set(T value) {
        const Guard guard(_locked);
        std::swap(_value, value);
    }

private:
    class Guard {
    public:
        explicit Guard(std::atomic_flag& locked) : _flag(locked) {
            while (_flag.test_and_set(std::memory_order_acquire)) _flag.wait(true, std::memory_order_relaxed);
        }
        ~Guard() {
            _flag.clear(std::memory_order_release);
            _flag.notify_one();
        }
        Guard(const Guard&) = delete;
        Guard& operator=(const Guard&) = delete;

    private:
        std::atomic_flag& _flag;
    };

    mutable std::atomic_flag _locked;
    T _value{};
};

} // namespace zembra
