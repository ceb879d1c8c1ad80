#pragma once

#include "platform/Transport.h"

#include <optional>
#include <sys/types.h>
#include <vector>

namespace platform::linux_ {

/// What the rights of a process to files hang on.
struct PeerRights {
    uid_t user = 0;
    gid_t group = 0;
    std::vector<gid_t> groups; // the supplementary ones
};

/// The rights that the peer of a Unix socket had when it connected. None when the kernel does not tell.
std::optional<PeerRights> rightsOfPeer(int connection);
std::optional<PeerRights> rightsOfPeer(const AuditToken& peer);

/// While one exists, this thread alone acts on files with a peer's rights instead of the daemon's own, which for root's
/// daemon reach everything. For a daemon of the peer's own user there is nothing to change.
class ActingAsPeer {
public:
    explicit ActingAsPeer(const std::optional<PeerRights>& peer);
    ~ActingAsPeer();
    ActingAsPeer(const ActingAsPeer&) = delete;
    ActingAsPeer& operator=(const ActingAsPeer&) = delete;

    /// False when the daemon may not take these rights: then nothing is to be done in the peer's name.
    bool isReady() const { return _ready; }

private:
    bool readOwnGroups();

    std::vector<gid_t> _ownGroups;
    bool _acting = false;
    bool _ready = false;
};

} // namespace platform::linux_
