#pragma once

#include "platform/linux/Interfaces.h"

namespace support {

/// The table of interfaces, which is memory in the real service too, with failures on demand. It starts empty, so every
/// name is refused until it is registered.
class FakeInterfaces final : public platform::linux_::Interfaces {
public:
    /// Names that cannot be created, as if another thread had been faster.
    std::set<std::string> taken;
    /// Names under which another thread registers an interface just before the caller does.
    std::set<std::string> overtaken;

    /// Registers a new interface and returns it.
    std::shared_ptr<platform::Interface> add(const std::string& name) {
        return platform::linux_::Interfaces::registerInterface(platform::linux_::Interfaces::create(name));
    }

    std::shared_ptr<platform::Interface> create(const std::string& name) override {
        return taken.contains(name) ? nullptr : platform::linux_::Interfaces::create(name);
    }
    std::shared_ptr<platform::Interface> registerInterface(std::shared_ptr<platform::Interface> interface) override {
        if (overtaken.contains(interface->name())) add(interface->name());
        return platform::linux_::Interfaces::registerInterface(std::move(interface));
    }
};

} // namespace support
