#include "platform/linux/SystemCallFilter.h"

#include "platform/linux/SystemError.h"

#include <cerrno>
#include <fcntl.h>
#include <memory>
#include <optional>
#include <sched.h>
#include <seccomp.h>
#include <sys/ioctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

namespace platform::linux_ {

namespace {

struct RefusedCall {
    const char* name;
    int number = -1; // where the library may be too old to know the name; such numbers are the same on all machines
};

/// Refused with EPERM.
constexpr RefusedCall refusedCalls[] = {
    // Other processes.
    {"ptrace"},
    {"process_vm_readv"},
    {"process_vm_writev"},
    {"process_madvise", 440},
    {"process_mrelease", 448},
    {"pidfd_getfd", 438},
    {"kcmp"},
    {"move_pages"},
    {"migrate_pages"},
    {"perf_event_open"},
    {"userfaultfd"},
    // Segments, queues and semaphores belong to the user, whichever of the user's processes made them. Their numbers
    // can be guessed, so using one is refused as getting it is.
    {"shmget"},
    {"shmat"},
    {"shmdt"},
    {"shmctl"},
    {"msgget"},
    {"msgsnd"},
    {"msgrcv"},
    {"msgctl"},
    {"semget"},
    {"semop"},
    {"semtimedop"},
    {"semtimedop_time64"},
    {"semctl"},
    {"ipc"}, // all of them, on some machines
    {"mq_open"},
    {"mq_unlink"},
    // Keys.
    {"add_key"},
    {"request_key"},
    {"keyctl"},
    // Namespaces, roots and mounts.
    {"unshare"},
    {"setns"},
    {"chroot"},
    {"pivot_root"},
    {"mount"},
    {"umount"},
    {"umount2"},
    {"open_tree", 428},
    {"open_tree_attr", 467},
    {"move_mount", 429},
    {"fsopen", 430},
    {"fsconfig", 431},
    {"fsmount", 432},
    {"fspick", 433},
    {"mount_setattr", 442},
    {"statmount", 457},
    {"listmount", 458},
    // Files past their paths, and what Landlock lets everybody do by path, or by a descriptor for reading only.
    {"name_to_handle_at"},
    {"open_by_handle_at"},
    {"fanotify_init"},
    {"inotify_add_watch"},
    {"quotactl"},
    {"quotactl_fd", 443},
    {"chmod"},
    {"fchmod"},
    {"fchmodat"},
    {"fchmodat2", 452},
    {"chown"},
    {"chown32"},
    {"fchown"},
    {"fchown32"},
    {"lchown"},
    {"lchown32"},
    {"fchownat"},
    {"getxattr"}, // some hold secrets, and a program's entitlements
    {"lgetxattr"},
    {"fgetxattr"},
    {"getxattrat", 464},
    {"listxattr"},
    {"llistxattr"},
    {"flistxattr"},
    {"listxattrat", 465},
    {"setxattr"},
    {"lsetxattr"},
    {"fsetxattr"},
    {"setxattrat", 463},
    {"removexattr"},
    {"lremovexattr"},
    {"fremovexattr"},
    {"removexattrat", 466},
    {"file_setattr", 469},
    {"utime"},
    {"utimes"},
    {"futimesat"},
    {"utimensat"},
    {"utimensat_time64"},
    // The machine.
    {"bpf"},
    {"kexec_load"},
    {"kexec_file_load"},
    {"init_module"},
    {"finit_module"},
    {"delete_module"},
    {"reboot"},
    {"swapon"},
    {"swapoff"},
    {"acct"},
    {"syslog"},
    {"vhangup"},
    {"iopl"},
    {"ioperm"},
    {"modify_ldt"},
    {"settimeofday"},
    {"clock_settime"},
    {"clock_adjtime"},
    {"adjtimex"},
    {"sethostname"},
    {"setdomainname"},
};

/// Refused with ENOSYS, so that libraries take the older way. What they are asked for lies in memory or in a ring,
/// where no filter sees it.
constexpr RefusedCall missingCalls[] = {
    {"clone3", 435}, {"openat2", 437}, {"io_uring_setup", 425}, {"io_uring_enter", 426}, {"io_uring_register", 427},
};

/// New namespaces, and a child of the own parent: the host, which would take it for one that it started.
constexpr int refusedCloneFlags[] = {CLONE_NEWNS,   CLONE_NEWCGROUP, CLONE_NEWUTS, CLONE_NEWIPC,
                                     CLONE_NEWUSER, CLONE_NEWPID,    CLONE_NEWNET, CLONE_PARENT};

constexpr std::uint64_t typingRequests[] = {TIOCSTI, TIOCLINUX};

/// The second byte of what file systems are asked for. Much of it needs an owner and a descriptor for reading alone:
/// setting a file's flags, sealing its content (fs-verity), encrypting a directory, making a volume in one. Cloning a
/// file goes with it; programs that want that copy it then.
constexpr std::uint64_t fileSystemRequestTypes[] = {'f', 'X', 0x94};
constexpr std::uint64_t requestTypeMask = 0xff00;

/// A call that makes a file: which of its arguments holds flags, and which the mode.
struct MakingCall {
    const char* name;
    std::optional<unsigned> flags; // none: it always makes one
    unsigned mode;
};
constexpr MakingCall makingCalls[] = {
    {"open", 1, 2},     {"openat", 2, 3}, {"creat", {}, 1},   {"mkdir", {}, 1},
    {"mkdirat", {}, 2}, {"mknod", {}, 1}, {"mknodat", {}, 2},
};
constexpr std::uint64_t makingFlags[] = {O_CREAT, O_TMPFILE};
constexpr std::uint64_t setIdBits[] = {S_ISUID, S_ISGID};

/// Who gets the signals of a socket or a pipe; the kernel sends them past what forbids sending any.
constexpr std::uint64_t signalReceiverRequests[] = {FIOSETOWN, SIOCSPGRP};
constexpr std::uint64_t signalReceiverCommands[] = {F_SETOWN, F_SETOWN_EX};

/// Of the process that their first argument names, where zero is the calling thread.
constexpr const char* schedulingCalls[] = {"sched_setaffinity", "sched_setscheduler", "sched_setparam",
                                           "sched_setattr"};

constexpr int ioPriorityOfProcess = 1; // no header of the library has it

/// The kernel reads arguments of type int from the lower half of a register alone, so the upper half must not make a
/// difference here either.
constexpr std::uint64_t lowerHalf = 0xffffffff;
constexpr std::uint64_t socketTypeMask = 0xf; // above are flags

/// Adds rules; the first failure stays.
class Filter {
public:
    Filter() : _context(seccomp_init(SCMP_ACT_ALLOW), seccomp_release) {
        if (!_context) _failure = ENOMEM;
        // Calls of another machine's numbering (32-bit ones) would pass unseen.
        if (_context) note(seccomp_attr_set(_context.get(), SCMP_FLTATR_ACT_BADARCH, SCMP_ACT_KILL_PROCESS));
        if (_context) note(seccomp_attr_set(_context.get(), SCMP_FLTATR_CTL_NNP, 0)); // the caller's part
    }

    template <class... Conditions> void refuse(const RefusedCall& call, int number, Conditions... conditions) {
        if (_failure != 0) return;
        int known = seccomp_syscall_resolve_name(call.name);
        if (known == __NR_SCMP_ERROR) known = call.number;
        if (known < 0) return; // not on this machine
        const scmp_arg_cmp all[] = {conditions..., scmp_arg_cmp{}};
        note(seccomp_rule_add_array(_context.get(), SCMP_ACT_ERRNO(static_cast<unsigned>(number)), known,
                                    static_cast<unsigned>(sizeof...(conditions)), all));
    }

    /// Zero, or an errno value.
    int load() {
        if (_failure == 0) note(seccomp_load(_context.get()));
        return _failure;
    }

private:
    void note(int result) {
        if (_failure == 0 && result < 0) _failure = -result;
    }
    std::unique_ptr<void, void (*)(scmp_filter_ctx)> _context;
    int _failure = 0;
};

scmp_arg_cmp argument(unsigned index, scmp_compare comparison, std::uint64_t value, std::uint64_t mask = 0) {
    // With a mask its value comes second.
    return comparison == SCMP_CMP_MASKED_EQ ? scmp_arg_cmp{index, comparison, mask, value}
                                            : scmp_arg_cmp{index, comparison, value, 0};
}

void refuseSockets(Filter& filter, Network network) {
    for (int family = 0; family <= AF_INET6; ++family) {
        const bool isInternet = family == AF_INET || family == AF_INET6;
        if (family == AF_UNIX || (isInternet && network != Network::none)) continue;
        filter.refuse({"socket"}, EACCES, argument(0, SCMP_CMP_EQ, static_cast<std::uint64_t>(family)));
    }
    filter.refuse({"socket"}, EACCES, argument(0, SCMP_CMP_GT, AF_INET6));
    filter.refuse({"socketpair"}, EACCES, argument(0, SCMP_CMP_NE, AF_UNIX));
    for (std::uint64_t type = 0; type <= socketTypeMask; ++type) {
        const auto ofType = argument(1, SCMP_CMP_MASKED_EQ, type, socketTypeMask);
        if (type != SOCK_SEQPACKET) filter.refuse({"socket"}, EACCES, argument(0, SCMP_CMP_EQ, AF_UNIX), ofType);
        // A pair of streams stays a pair; one end of a pair of datagram sockets can be sent from to anywhere.
        if (type != SOCK_SEQPACKET && type != SOCK_STREAM) filter.refuse({"socketpair"}, EACCES, ofType);
    }
    if (network != Network::server) filter.refuse({"listen"}, EACCES);
}

/// A set-user-id program in the container would give its user's rights to whoever can execute it. Without one of the
/// flags nothing is made, and any number may stand where the mode would.
void refuseSetIdFiles(Filter& filter) {
    for (const auto& [name, flags, mode] : makingCalls) {
        for (const std::uint64_t bit : setIdBits) {
            const auto hasBit = argument(mode, SCMP_CMP_MASKED_EQ, bit, bit);
            if (!flags) {
                filter.refuse({name}, EPERM, hasBit);
                continue;
            }
            for (const std::uint64_t makes : makingFlags) {
                filter.refuse({name}, EPERM, argument(*flags, SCMP_CMP_MASKED_EQ, makes, makes), hasBit);
            }
        }
    }
}

/// Of other processes: the host would run when and where its plug-in wants.
void refuseScheduling(Filter& filter) {
    for (const char* name : schedulingCalls) filter.refuse({name}, EPERM, argument(0, SCMP_CMP_NE, 0));
    filter.refuse({"setpriority"}, EPERM, argument(0, SCMP_CMP_NE, PRIO_PROCESS));
    filter.refuse({"setpriority"}, EPERM, argument(1, SCMP_CMP_NE, 0));
    filter.refuse({"ioprio_set"}, EPERM, argument(0, SCMP_CMP_NE, ioPriorityOfProcess));
    filter.refuse({"ioprio_set"}, EPERM, argument(1, SCMP_CMP_NE, 0));
}

/// Landlock before version 3 knows nothing of truncating: who may open a file to read it may empty it so. Access mode 3
/// is for neither reading nor writing, and passes any rule.
void refuseTruncating(Filter& filter) {
    filter.refuse({"truncate"}, EPERM);
    for (const int access : {O_RDONLY, O_ACCMODE}) {
        const auto truncates = [access](unsigned index) {
            return argument(index, SCMP_CMP_MASKED_EQ, static_cast<std::uint64_t>(access | O_TRUNC),
                            O_ACCMODE | O_TRUNC);
        };
        filter.refuse({"open"}, EPERM, truncates(1));
        filter.refuse({"openat"}, EPERM, truncates(2));
    }
}

/// Landlock before version 6 knows nothing of signals.
void refuseSignals(Filter& filter) {
    for (const char* name : {"kill", "tkill", "rt_sigqueueinfo", "pidfd_send_signal"}) filter.refuse({name}, EPERM);
    const auto own = static_cast<std::uint64_t>(::getpid());
    for (const char* name : {"tgkill", "rt_tgsigqueueinfo"})
        filter.refuse({name}, EPERM, argument(0, SCMP_CMP_NE, own));
    for (const std::uint64_t command : signalReceiverCommands) {
        filter.refuse({"fcntl"}, EPERM, argument(1, SCMP_CMP_MASKED_EQ, command, lowerHalf));
    }
    for (const std::uint64_t request : signalReceiverRequests) {
        filter.refuse({"ioctl"}, EPERM, argument(1, SCMP_CMP_MASKED_EQ, request, lowerHalf));
    }
}

} // namespace

Failure filterSystemCalls(Network network, int landlock) {
    Filter filter;
    for (const auto& call : refusedCalls) filter.refuse(call, EPERM);
    for (const auto& call : missingCalls) filter.refuse(call, ENOSYS);
    for (const int flag : refusedCloneFlags) {
        const auto bits = static_cast<std::uint64_t>(flag);
        filter.refuse({"clone"}, EPERM, argument(0, SCMP_CMP_MASKED_EQ, bits, bits));
    }
    // Another process's limits are set with the same call as one's own.
    filter.refuse({"prlimit64"}, EPERM, argument(0, SCMP_CMP_NE, 0));
    // Typing into the terminal that was inherited.
    for (const std::uint64_t request : typingRequests) {
        filter.refuse({"ioctl"}, EPERM, argument(1, SCMP_CMP_MASKED_EQ, request, lowerHalf));
    }
    for (const std::uint64_t type : fileSystemRequestTypes) {
        filter.refuse({"ioctl"}, EPERM, argument(1, SCMP_CMP_MASKED_EQ, type << 8U, requestTypeMask));
    }
    refuseSetIdFiles(filter);
    refuseSockets(filter, network);
    refuseScheduling(filter);
    if (landlock < 3) refuseTruncating(filter);
    if (landlock < 6) refuseSignals(filter);
    if (const int number = filter.load()) return systemError(number, "system call filter");
    return std::nullopt;
}

} // namespace platform::linux_
