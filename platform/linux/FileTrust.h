#pragma once

#include "platform/PropertyList.h"
#include "platform/linux/Descriptor.h"

#include <cstddef>
#include <optional>
#include <string>

/// Files that grant or decide something, believed because nobody else could have written them.
namespace platform::linux_ {

/// Zero when only the superuser and this process's user can change the open file or directory, else an errno value:
/// EPERM for a foreign owner, EACCES when others may write. An access list that lets a named user write shows in the
/// group's bits.
int trustError(int descriptor);

/// True where owner and attributes are the kernel's own word and not that of whoever brought the file system: an
/// ordinary user may mount a FUSE file system or a stick with files of any owner and attribute, but only with nosuid.
/// What is in memory alone was made on this machine, so nosuid, usual there, does not matter.
bool isTrustedFileSystem(int descriptor);

/// A directory without `trustError`. Its name may not be a symbolic link.
Result<Descriptor> openTrustedDirectory(const std::string& path);

/// The property list `name` in an open directory: a regular file, no link, without `trustError`, at most `limit` bytes
/// long, and a dictionary. None when there is no such name.
Result<std::optional<Dictionary>> readTrustedDictionary(int directory, const std::string& name, std::size_t limit);

} // namespace platform::linux_
