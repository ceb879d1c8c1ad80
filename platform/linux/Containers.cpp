#include "platform/linux/Containers.h"

#include "platform/linux/SystemError.h"
#include "platform/linux/UserDirectory.h"

#include <fcntl.h>
#include <unistd.h>

namespace platform::linux_ {

Containers::Containers(Root root, uid_t user) : _root(std::move(root)), _user(user) {}

Result<std::string> Containers::userContainer(const std::string& identifier) {
    if (const int number = pathComponentError(identifier)) return systemError(number, "container identifier");
    auto directory = openUserDirectory(_root.users(), _user, {"Containers", identifier}, MissingDirectory::made);
    if (!directory) return directory.error();
    return _root.users() + '/' + std::to_string(_user) + "/Containers/" + identifier;
}

void Containers::discardEmpty(const std::string& identifier) {
    if (pathComponentError(identifier) != 0) return;
    const auto directory = openUserDirectory(_root.users(), _user, {"Containers"}, MissingDirectory::refused);
    // One that is in use is not empty, and stays.
    if (directory) static_cast<void>(::unlinkat(directory->get(), identifier.c_str(), AT_REMOVEDIR));
}

} // namespace platform::linux_
