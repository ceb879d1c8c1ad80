#pragma once

#include "platform/Error.h"

#include <string>
#include <system_error>

namespace platform::linux_ {

/// An error that carries the errno value `number`, with the system's text behind `what`.
inline Error systemError(int number, const std::string& what) {
    return Error{posixErrorDomain, number, what + ": " + std::generic_category().message(number)};
}

} // namespace platform::linux_
