#pragma once

#include "platform/Files.h"
#include "platform/linux/Root.h"

namespace platform::linux_ {

/// Whole-file reading and atomic replacement with system calls. Stateless; callable from any thread.
class Files final : public platform::Files {
public:
    explicit Files(Root root) : _root(std::move(root)) {}

    std::string locate(const std::string& wellKnownPath) override;
    Result<std::string> read(const std::string& path, std::size_t limit) override;
    /// The temporary file has one fixed name per target (`.NAME.saving` beside it) and is locked while it is written.
    /// So writers in any number of threads and processes take turns, and what a killed writer left is one file at the
    /// most, which the next save takes over.
    Failure writeAtomically(const std::string& path, std::string_view bytes) override;
    Failure setAside(const std::string& path, std::string_view suffix) override;
    Result<std::string> realPath(const std::string& path, std::size_t limit) override;
    /// Never leads through the links of /proc that stand for open files and directories of processes: to follow them is
    /// the daemon's right, whoever it acts as.
    Result<std::string> realPath(const std::string& path, std::size_t limit, const AuditToken& peer) override;

private:
    Root _root;
};

} // namespace platform::linux_
