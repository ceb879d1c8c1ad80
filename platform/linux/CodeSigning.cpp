#include "platform/linux/CodeSigning.h"

#include "platform/linux/Descriptor.h"
#include "platform/linux/Entitlements.h"
#include "platform/linux/PeerProcess.h"
#include "platform/linux/SystemError.h"

#include <cerrno>
#include <fcntl.h>
#include <mutex>
#include <sys/stat.h>

namespace platform::linux_ {

namespace {

class PeerTask final : public SecTask {
public:
    explicit PeerTask(std::shared_ptr<const LinuxPeerProcess> process) : _process(std::move(process)) {}

    /// Failures are not kept: the next query may find descriptors free again.
    Result<Dictionary> entitlements() {
        std::lock_guard lock(_mutex);
        if (_entitlements) return *_entitlements;
        auto read = readOfProcess();
        if (!read) return read.error();
        _entitlements = *std::move(read);
        return *_entitlements;
    }

private:
    Result<Dictionary> readOfProcess() const {
        const std::string path = "/proc/" + std::to_string(_process->pid()) + "/exe";
        Descriptor program(open(path.c_str(), O_PATH | O_CLOEXEC));
        if (!program) return systemError(errno == ENOENT ? ESRCH : errno, path);
        struct stat status{};
        if (fstat(program.get(), &status) != 0) return systemError(errno, path);
        // The process still lives, so it was its file, and not that of a later owner of the pid, that was opened.
        if (!_process->isAlive() || _process->program() != ProgramIdentity{status.st_dev, status.st_ino})
            return systemError(ESRCH, path);
        auto entitlements = readEntitlements(program.get());
        if (!entitlements) return entitlements.error();
        return entitlements->value_or(Dictionary());
    }

    const std::shared_ptr<const LinuxPeerProcess> _process;
    std::mutex _mutex;
    std::optional<Dictionary> _entitlements; // guarded by _mutex
};

} // namespace

std::shared_ptr<SecTask> CodeSigning::taskFromAuditToken(const AuditToken& token) {
    auto process = std::dynamic_pointer_cast<const LinuxPeerProcess>(token.process);
    if (!process || !process->program().isKnown()) return nullptr;
    return std::make_shared<PeerTask>(std::move(process));
}

EntitlementValue CodeSigning::copyEntitlement(const std::shared_ptr<SecTask>& task, const std::string& name) {
    auto peer = std::dynamic_pointer_cast<PeerTask>(task);
    if (!peer) return {Value(), systemError(EINVAL, "task")};
    auto entitlements = peer->entitlements();
    if (!entitlements) return {Value(), entitlements.error()};
    return {(*entitlements)[name], std::nullopt};
}

} // namespace platform::linux_
