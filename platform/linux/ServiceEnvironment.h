#pragma once

#include "platform/Error.h"
#include "platform/PropertyList.h"
#include "platform/linux/ConfinementProfiles.h"

#include <optional>
#include <string>
#include <utility>
#include <variant>
#include <vector>

namespace platform::linux_ {

/// What an activation overlay asks for.
struct ServiceDescription {
    using Variable = std::pair<std::string, std::string>;
    const ConfinementProfile* profile = nullptr;
    std::vector<Variable> variables;
    std::vector<std::string> dropped; // names of variables that no service is given
};

/// Reads an overlay; or says what is wrong with it.
std::variant<ServiceDescription, std::string> readServiceDescription(const Dictionary& overlay);

/// True for variables that decide which code a program loads, where its libraries look for their files, or which
/// platform it belongs to. Neither host nor manifest sets them: code that a host loads into a service would act with
/// the service's entitlements.
bool isReservedVariable(std::string_view name);

/// The service's whole environment, as NAME=value: a few variables of this process, then the service's own, which
/// replace them. Values at or below `managersContainer` (a path) are moved to `container`: the manager may be another
/// user's daemon, and it names the container of its own user.
std::vector<std::string> serviceEnvironment(const ServiceDescription& service, const std::string& managersContainer,
                                            const std::string& container);

} // namespace platform::linux_
