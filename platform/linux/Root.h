#pragma once

#include <string>

namespace platform::linux_ {

/// Where the platform's state lives below its root: `/`, or the directory that the environment variable
/// `NORDANE_ROOT` names, so that a whole platform runs in a scratch directory without privileges.
class Root {
public:
    /// `directory` is absolute. A trailing separator is dropped, so that `/` gives paths with one separator.
    explicit Root(std::string directory) : _directory(std::move(directory)) {
        while (!_directory.empty() && _directory.back() == '/') _directory.pop_back();
    }

    /// The root of this process: `NORDANE_ROOT` with symbolic links resolved, else `/`.
    static Root ofProcess();

    std::string applications() const { return _directory + "/Applications"; }
    /// The system volume: applications in `Applications`, plug-ins outside applications in `Library/PlugIns`,
    /// SDK dictionaries in `Library/SDKs`.
    std::string system() const { return _directory + "/System"; }
    std::string database() const { return _directory + "/var/db"; }
    std::string runtime() const { return _directory + "/run/nordane"; }
    /// Per-user state, a directory per user id with `Preferences` and `Containers` in it.
    std::string users() const { return _directory + "/var/db/users"; }
    /// Empty for `/`.
    const std::string& directory() const { return _directory; }
    /// `path` below this root.
    std::string at(const std::string& path) const { return _directory + path; }
    /// True when this is the machine's own root and not a scratch one.
    bool isMachine() const { return _directory.empty(); }

private:
    std::string _directory;
};

} // namespace platform::linux_
