#pragma once

#include "platform/linux/Interfaces.h"

namespace support {

/// The table of interfaces, which is memory in the real service too. It starts empty, so every name is refused until it
/// is registered.
class FakeInterfaces final : public platform::linux_::Interfaces {
public:
    /// Registers a new interface and returns it.
    std::shared_ptr<platform::Interface> add(const std::string& name) { return registerInterface(create(name)); }
};

} // namespace support
