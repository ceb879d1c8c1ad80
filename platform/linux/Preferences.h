#pragma once

#include "platform/Error.h"
#include "platform/Preferences.h"
#include "platform/linux/Root.h"

#include <ctime>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>

namespace platform::linux_ {

/// Preferences as property lists: `<root>/var/db/users/<uid>/Preferences/<domain>.<host name>.vlist`, so that a home
/// shared by several machines has a file for each. The file must belong to the user or the superuser, be writable by
/// its owner alone, and lie in a private directory of the user. The host name is the one at construction. Callable from
/// any thread.
class Preferences final : public platform::Preferences {
public:
    explicit Preferences(Root root, uid_t user = ::geteuid());

    /// A domain that cannot be part of a file name is not added.
    void addDomain(const std::string& domain) override;
    /// Costs one stat when the file is the one read last. A missing file holds no values.
    bool synchronize(const std::string& domain) override;
    Value value(const std::string& domain, const std::string& key) override;

private:
    /// What tells one state of a file from another without reading it.
    struct Identity {
        dev_t device = 0;
        ino_t inode = 0;
        off_t size = 0;
        timespec modified{};
        timespec changed{};
    };
    struct Stored {
        Dictionary values;
        std::optional<Identity> identity; // none when another write could look the same
    };
    struct Domain {
        Dictionary values;
        std::optional<Identity> identity;
        bool isReadable = true; // what the last reading of the file with that identity gave
    };

    static Identity identityOf(const struct stat& status);
    static bool isSame(const Identity& left, const Identity& right);
    std::string fileName(const std::string& domain) const;
    std::string path(const std::string& domain) const;
    Result<Stored> read(const std::string& domain) const;

    const Root _root;
    const uid_t _user;
    const std::string _host;

    std::mutex _mutex;
    std::map<std::string, Domain, std::less<>> _domains;
};

} // namespace platform::linux_
