#pragma once

#include <cstdint>
#include <memory>
#include <set>
#include <string>
#include <vector>

namespace platform {

class Interface;

enum class InterfaceSide { request, reply };

/// A named remote interface and what it includes. Not changed after it was registered.
class Interface {
public:
    virtual ~Interface() = default;
    virtual const std::string& name() const = 0;
    virtual void addIncluded(std::shared_ptr<Interface> included) = 0;
    virtual std::vector<std::shared_ptr<Interface>> included() const = 0;
};

/// How one interface is used on a connection: per argument of its operations the classes or the nested interface that
/// may travel there.
class InterfaceDescription {
public:
    virtual ~InterfaceDescription() = default;
    virtual void setClasses(const std::set<std::string>& classes, const std::string& operation, std::int64_t argument,
                            InterfaceSide side) = 0;
    virtual void setInterface(std::shared_ptr<InterfaceDescription> nested, const std::string& operation,
                              std::int64_t argument, InterfaceSide side) = 0;
    /// What was set; empty or null when nothing was.
    virtual std::set<std::string> classes(const std::string& operation, std::int64_t argument,
                                          InterfaceSide side) const = 0;
    virtual std::shared_ptr<InterfaceDescription> nestedInterface(const std::string& operation, std::int64_t argument,
                                                                  InterfaceSide side) const = 0;
    virtual std::shared_ptr<Interface> interface() const = 0;
};

/// The process's table of interfaces and of the classes that may be named. Callable from any thread.
class Interfaces {
public:
    virtual ~Interfaces() = default;
    /// Null when no interface of that name is registered.
    virtual std::shared_ptr<Interface> find(const std::string& name) = 0;
    /// A new interface, not yet registered. Null when one of that name is registered already.
    virtual std::shared_ptr<Interface> create(const std::string& name) = 0;
    /// The interface that stands under the name from now on: of several that are registered under one name the first.
    virtual std::shared_ptr<Interface> registerInterface(std::shared_ptr<Interface> interface) = 0;
    virtual bool isKnownClass(const std::string& name) = 0;
    virtual void addClass(const std::string& name) = 0;
    virtual std::shared_ptr<InterfaceDescription> describe(std::shared_ptr<Interface> interface) = 0;
};

} // namespace platform
