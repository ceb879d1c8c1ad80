#pragma once

#include "platform/Containers.h"
#include "platform/linux/Root.h"

#include <sys/types.h>
#include <unistd.h>

namespace platform::linux_ {

/// Containers as directories: `<root>/var/db/users/<uid>/Containers/<identifier>`. Every directory from `<uid>` on
/// belongs to the user and is closed to others; symbolic links among them are refused. Callable from any thread.
class Containers final : public platform::Containers {
public:
    explicit Containers(Root root, uid_t user = ::geteuid());

    Result<std::string> userContainer(const std::string& identifier) override;
    void discardEmpty(const std::string& identifier) override;

private:
    const Root _root;
    const uid_t _user;
};

} // namespace platform::linux_
