#pragma once

#include "platform/Error.h"
#include "platform/PropertyList.h"

#include <optional>
#include <string>

namespace platform::linux_ {

/// Entitlements travel with a program as a property list in an extended attribute of its file. Only a privileged
/// signer can write the first name. But the attribute stays when the file is written to later, so it is believed only
/// on files that belong to root or to the daemon's own user and that nobody else may write to; and, unless the file
/// system is in memory alone, only where it is not mounted nosuid, since others may bring such a file system along.
/// The second name is believed by an unprivileged per-user daemon alone, and only on files that its own user owns and
/// nobody else may write to.
inline constexpr const char* entitlementsAttribute = "security.nordane.entitlements";
inline constexpr const char* userEntitlementsAttribute = "user.nordane.entitlements";

/// The largest attribute that is read; the file systems in use hold no more than this in one attribute.
inline constexpr std::size_t maximumEntitlementsSize = 65536;

/// The entitlements of the open program file. None when it carries none that may be believed; an error when the
/// attribute cannot be read or is no property-list dictionary.
Result<std::optional<Dictionary>> readEntitlements(int descriptor);
/// The same by path (symbolic links followed; "/proc/<pid>/exe" works).
Result<std::optional<Dictionary>> readEntitlements(const std::string& path);

/// Writes the attribute that the caller's privileges allow: the first name for a privileged caller, else the second.
/// Refuses (EPERM) where it would not be believed.
Failure writeEntitlements(const std::string& path, const Dictionary& entitlements);

/// Removes every attribute that the caller's privileges allow to remove; no failure when there is none.
Failure removeEntitlements(const std::string& path);

} // namespace platform::linux_
