#include "platform/linux/Interfaces.h"

#include <cassert>
#include <tuple>
#include <utility>

namespace platform::linux_ {

namespace {

class NamedInterface final : public Interface {
public:
    explicit NamedInterface(std::string name) : _name(std::move(name)) {}

    const std::string& name() const override { return _name; }

    void addIncluded(std::shared_ptr<Interface> included) override {
        assert(included);
        const std::lock_guard lock(_mutex);
        _included.push_back(std::move(included));
    }

    std::vector<std::shared_ptr<Interface>> included() const override {
        const std::lock_guard lock(_mutex);
        return _included;
    }

private:
    const std::string _name;
    mutable std::mutex _mutex;
    std::vector<std::shared_ptr<Interface>> _included;
};

class Description final : public InterfaceDescription {
public:
    explicit Description(std::shared_ptr<Interface> interface) : _interface(std::move(interface)) {}

    void setClasses(const std::set<std::string>& classes, const std::string& operation, std::int64_t argument,
                    InterfaceSide side) override {
        const std::lock_guard lock(_mutex);
        _arguments[{operation, argument, side}].classes = classes;
    }

    void setInterface(std::shared_ptr<InterfaceDescription> nested, const std::string& operation, std::int64_t argument,
                      InterfaceSide side) override {
        const std::lock_guard lock(_mutex);
        _arguments[{operation, argument, side}].nested = std::move(nested);
    }

    std::set<std::string> classes(const std::string& operation, std::int64_t argument,
                                  InterfaceSide side) const override {
        return argumentAt({operation, argument, side}).classes;
    }

    std::shared_ptr<InterfaceDescription> nestedInterface(const std::string& operation, std::int64_t argument,
                                                          InterfaceSide side) const override {
        return argumentAt({operation, argument, side}).nested;
    }

    std::shared_ptr<Interface> interface() const override { return _interface; }

private:
    using Place = std::tuple<std::string, std::int64_t, InterfaceSide>;
    struct Argument {
        std::set<std::string> classes;
        std::shared_ptr<InterfaceDescription> nested;
    };

    Argument argumentAt(const Place& place) const {
        const std::lock_guard lock(_mutex);
        const auto found = _arguments.find(place);
        return found == _arguments.end() ? Argument{} : found->second;
    }

    const std::shared_ptr<Interface> _interface;
    mutable std::mutex _mutex;
    std::map<Place, Argument> _arguments;
};

} // namespace

std::shared_ptr<Interface> Interfaces::find(const std::string& name) {
    const std::lock_guard lock(_mutex);
    const auto found = _interfaces.find(name);
    return found == _interfaces.end() ? nullptr : found->second;
}

std::shared_ptr<Interface> Interfaces::create(const std::string& name) {
    if (find(name)) return nullptr;
    return std::make_shared<NamedInterface>(name);
}

std::shared_ptr<Interface> Interfaces::registerInterface(std::shared_ptr<Interface> interface) {
    assert(interface);
    const std::lock_guard lock(_mutex);
    return _interfaces.try_emplace(interface->name(), interface).first->second;
}

bool Interfaces::isKnownClass(const std::string& name) {
    const std::lock_guard lock(_mutex);
    return _classes.contains(name);
}

void Interfaces::addClass(const std::string& name) {
    const std::lock_guard lock(_mutex);
    _classes.insert(name);
}

std::shared_ptr<InterfaceDescription> Interfaces::describe(std::shared_ptr<Interface> interface) {
    assert(interface);
    return std::make_shared<Description>(std::move(interface));
}

} // namespace platform::linux_
