#include "platform/linux/Containers.h"

#include "platform/linux/SystemError.h"
#include "platform/linux/UserDirectory.h"

namespace platform::linux_ {

Containers::Containers(Root root, uid_t user) : _root(std::move(root)), _user(user) {}

Result<std::string> Containers::userContainer(const std::string& identifier) {
    if (const int number = pathComponentError(identifier)) return systemError(number, "container identifier");
    auto directory = openUserDirectory(_root, _user, {"Containers", identifier}, MissingDirectory::made);
    if (!directory) return directory.error();
    return _root.users() + '/' + std::to_string(_user) + "/Containers/" + identifier;
}

} // namespace platform::linux_
