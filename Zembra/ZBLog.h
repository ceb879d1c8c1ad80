#pragma once

#include "platform/SystemLog.h"

/// The log channels of the system: `log::ops().debug("new client %d %s", pid, path)`.
/// Each handle is made when first used and kept as long as the process lives. Any thread.
namespace zembra::log {

/// Almost everything: server, clients, requests, database, annotations, activation, holds.
platform::LogHandle& ops();
/// The walk of UUID lists in requests, and requests and replies on the requester's side.
platform::LogHandle& traffic();
/// Evaluation of match filters.
platform::LogHandle& extension();
/// The application registry: manifests, localization.
platform::LogHandle& cx();
/// Sandbox extensions: issue, consume, release.
platform::LogHandle& sandbox();

} // namespace zembra::log
