#pragma once

#include <unistd.h>
#include <utility>

namespace platform::linux_ {

/// Owns a file descriptor and closes it.
class Descriptor {
public:
    Descriptor() = default;
    explicit Descriptor(int descriptor) : _descriptor(descriptor) {}
    Descriptor(Descriptor&& other) noexcept : _descriptor(other.release()) {}
    Descriptor& operator=(Descriptor&& other) noexcept {
        if (this != &other) reset(other.release());
        return *this;
    }
    ~Descriptor() { reset(); }

    explicit operator bool() const { return _descriptor >= 0; }
    int get() const { return _descriptor; }
    int release() { return std::exchange(_descriptor, -1); }
    void reset(int descriptor = -1) {
        // Never tried again on EINTR: the descriptor is gone by then, and another thread may have its number.
        if (const int old = std::exchange(_descriptor, descriptor); old >= 0) ::close(old);
    }

private:
    int _descriptor = -1;
};

} // namespace platform::linux_
