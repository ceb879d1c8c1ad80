#pragma once

#include "platform/Error.h"
#include "platform/Interfaces.h"
#include "platform/PropertyList.h"

#include <memory>
#include <string>
#include <string_view>

/// Finding and combining named interfaces, and describing what may travel in their operations.
namespace zembra {

/// The registered interface of that name. When there is none it is logged, `error` (unless null) is set, and the
/// answer is null.
std::shared_ptr<platform::Interface> interfaceLookup(platform::Interfaces& interfaces, const std::string& name,
                                                     platform::Failure* error);

/// One interface for a name, or for all names of an array, where the same names in the same order give every caller the
/// same interface. Null, with `error` (unless null) set, when one of them cannot be found; null without an error when
/// `nameOrNames` is neither.
std::shared_ptr<platform::Interface> compoundInterface(platform::Interfaces& interfaces,
                                                       const platform::Value& nameOrNames, platform::Failure* error);

/// Applies a text such as "request:0:{A+B},reply:1:P" to one operation of `description`: argument 0 of the request may
/// be of the classes A and B, and argument 1 of the reply is an object with the interface P. Entries take effect one by
/// one; the first faulty one ends it with an error.
platform::Failure interfaceClassSpecification(platform::Interfaces& interfaces,
                                              platform::InterfaceDescription& description, const std::string& operation,
                                              std::string_view classes);

} // namespace zembra
