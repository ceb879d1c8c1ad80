#pragma once

#include "platform/Interfaces.h"

#include <functional>
#include <map>
#include <mutex>

namespace platform::linux_ {

/// The table of this process.
class Interfaces : public platform::Interfaces {
public:
    std::shared_ptr<Interface> find(const std::string& name) override;
    std::shared_ptr<Interface> create(const std::string& name) override;
    std::shared_ptr<Interface> registerInterface(std::shared_ptr<Interface> interface) override;
    bool isKnownClass(const std::string& name) override;
    void addClass(const std::string& name) override;
    std::shared_ptr<InterfaceDescription> describe(std::shared_ptr<Interface> interface) override;

private:
    std::mutex _mutex;
    std::map<std::string, std::shared_ptr<Interface>, std::less<>> _interfaces;
    std::set<std::string, std::less<>> _classes;
};

} // namespace platform::linux_
