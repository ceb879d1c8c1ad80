#pragma once

#include <filesystem>
#include <stdlib.h>
#include <string>

namespace support {

/// A directory of its own under /tmp or another place, removed with everything in it.
class ScratchDirectory {
public:
    explicit ScratchDirectory(const std::string& place = "/tmp") {
        std::string name = place + "/zbd-test-XXXXXX";
        _path = std::filesystem::canonical(mkdtemp(name.data())).string();
    }
    ~ScratchDirectory() {
        std::error_code ignored; // a test that made something undeletable has failed already
        std::filesystem::remove_all(_path, ignored);
    }
    ScratchDirectory(const ScratchDirectory&) = delete;
    ScratchDirectory& operator=(const ScratchDirectory&) = delete;

    const std::string& path() const { return _path; }
    std::string operator/(const std::string& name) const { return _path + "/" + name; }

private:
    std::string _path;
};

/// Moves what is at `path` aside and puts a symbolic link to it there.
inline void putBehindLink(const std::string& path) {
    std::filesystem::rename(path, path + ".moved");
    std::filesystem::create_symlink(path + ".moved", path);
}

} // namespace support
