#pragma once

#include "platform/Error.h"
#include "platform/linux/Descriptor.h"

#include <initializer_list>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace platform::linux_ {

/// Zero when `name` can serve as one component of a path, else an errno value: EINVAL for an empty name, ".", ".." and
/// names with a separator or control characters, ENAMETOOLONG for more than 255 bytes. Names come from manifests and
/// peers, so every name that becomes part of a path passes here first.
int pathComponentError(std::string_view name);

enum class MissingDirectory { refused, made };

/// Opens `path`, a directory that holds a private one for every user, named by the user's id. It must belong to the
/// superuser or to `user`, and others may add their own to it but not touch what is there (as in /tmp). A missing one
/// is made, by the superuser for every user, else for the caller alone. One that this process may not list is opened as
/// a mere reference (O_PATH). Errors as below.
Result<Descriptor> openUsersDirectory(const std::string& path, uid_t user, MissingDirectory missing);

/// Opens the directory `components` below the private directory of `user` in the directory `users`. From that private
/// directory on, every directory must be a real one (symbolic links are not followed), belong to `user` and be closed
/// to everybody else; missing ones are made so. Errors carry errno; EPERM tells of a foreign owner, EACCES of an open
/// mode.
Result<Descriptor> openUserDirectory(const std::string& users, uid_t user,
                                     std::initializer_list<std::string_view> components, MissingDirectory missing);

} // namespace platform::linux_
