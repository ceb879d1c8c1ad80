#include "platform/linux/ConfinementProfiles.h"
#include "platform/linux/ServiceManager.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <fstream>
#include <linux/fs.h>
#include <set>
#include <sys/ioctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>

using namespace platform;
namespace fs = std::filesystem;

namespace {

using linux_::Descriptor;

constexpr std::uint64_t upperHalf = 1ULL << 32U; // of an argument, which the kernel does not look at

enum class Keeper {
    filter,
    landlock,
    signalFilter, // before version 6; from then on Landlock, when the signal is due
    nobody,
};
using enum Keeper;

struct Attempt {
    std::string name;
    Keeper keeper; // who refuses it
    std::function<int()> make;
};

/// Zero, or why not.
int result(long value) { return value < 0 ? errno : 0; }

/// A system call.
template <class... Arguments>
Attempt call(const std::string& name, Keeper keeper, long number, Arguments... arguments) {
    return {name, keeper, [=] { return result(syscall(number, arguments...)); }};
}
int executes(const char* path) {
    return support::resultInChild([path] {
        execl(path, path, nullptr);
        return errno;
    });
}
int forks(long flags) {
    const long child = syscall(SYS_clone, flags | SIGCHLD, nullptr, nullptr, nullptr, nullptr);
    if (child == 0) _exit(0);
    return result(child);
}
/// A home, a bundle, and two containers.
class Confinement : public testing::Test {
protected:
    Confinement() {
        for (const char* directory : {"home", "Bundle", "own/tmp", "other"}) fs::create_directories(at(directory));
        for (const char* file : {"home/secret", "Bundle/Resource", "other/secret"}) std::ofstream(at(file)) << file;
        std::ofstream(at("own/script")) << "#!/bin/true\n";
        chmod(at("own/script").c_str(), 0755);
        fs::copy_file(fs::canonical("/bin/true"), at("Bundle/Program"));
        for (const char* path : {"Bundle", "own"}) _places.emplace_back(open(at(path).c_str(), O_PATH | O_CLOEXEC));
    }

    std::string at(const std::string& name) const { return _scratch / name; }
    bool confine(const char* profile, int version) const {
        const linux_::OwnPlace own[] = {{_places[0].get(), linux_::readFiles | linux_::executeFiles},
                                        {_places[1].get(), linux_::readFiles | linux_::changeFiles}};
        return !linux_::confine(*linux_::findConfinementProfile(profile), own, version);
    }
    /// Runs `body` in a confined child of this process, in the scratch directory. What fails there shows.
    void inConfined(const char* profile, int version, const std::function<void()>& body) const {
        const int failures = support::resultInChild([&] {
            EXPECT_EQ(chdir(_scratch.path().c_str()), 0);
            EXPECT_TRUE(confine(profile, version));
            body();
            return HasFailure() ? 1 : 0;
        });
        EXPECT_EQ(failures, 0) << profile << " under version " << version;
    }

    support::ScratchDirectory _scratch;
    std::vector<Descriptor> _places; // bundle and container
};

} // namespace

TEST_F(Confinement, KeepsAServiceToItsOwn) {
    const pid_t parent = getpid();
    const std::string environment = "/proc/" + std::to_string(parent) + "/environ";
    std::vector<Attempt> attempts = {
        call("read the bundle", nobody, SYS_openat, AT_FDCWD, "Bundle/Resource", O_RDONLY),
        {"execute the bundle's program", nobody, [] { return executes("Bundle/Program"); }},
        call("make a file in the container", nobody, SYS_openat, AT_FDCWD, "own/new", O_RDWR | O_CREAT, 0600),
        call("write to nothing", nobody, SYS_openat, AT_FDCWD, "/dev/null", O_WRONLY),
        {"signal itself", nobody, [] { return result(raise(SIGCHLD)); }},

        call("read the home", landlock, SYS_openat, AT_FDCWD, "home/secret", O_RDONLY),
        call("read another container", landlock, SYS_openat, AT_FDCWD, "other/secret", O_RDONLY),
        call("remove another's file", landlock, SYS_unlinkat, AT_FDCWD, "other/secret", 0),
        call("write to the bundle", landlock, SYS_openat, AT_FDCWD, "Bundle/Resource", O_WRONLY),
        call("truncate the bundle", landlock, SYS_truncate, "Bundle/Resource", 0L),
        call("truncate it by opening to read", landlock, SYS_openat, AT_FDCWD, "Bundle/Resource", O_RDONLY | O_TRUNC),
        call("truncate by opening for nothing", landlock, SYS_openat, AT_FDCWD, "home/secret", O_ACCMODE | O_TRUNC),
        call("read the users", landlock, SYS_openat, AT_FDCWD, "/etc/passwd", O_RDONLY),
        {"execute a system program", landlock, [] { return executes("/bin/true"); }},
        {"execute a script of its own", landlock, [] { return executes("own/script"); }},
        call("read its parent's environment", landlock, SYS_openat, AT_FDCWD, environment.c_str(), O_RDONLY),

        call("signal its parent", filter, SYS_kill, parent, 0),
        call("signal its parent's thread", filter, SYS_tgkill, parent, parent, 0),
        call("have its parent signalled", signalFilter, SYS_fcntl, STDIN_FILENO, F_SETOWN, parent),
        call("limit its parent", filter, SYS_prlimit64, parent, RLIMIT_CORE, nullptr, nullptr),
        call("set its parent's priority", filter, SYS_setpriority, PRIO_PROCESS, parent, 0),
        call("set a file's flags", filter, SYS_ioctl, STDIN_FILENO, FS_IOC_SETFLAGS | upperHalf, nullptr),
        call("make a set-user-id file", filter, SYS_openat, AT_FDCWD, "own/setuid", O_WRONLY | O_CREAT, 04755),
        call("make a nameless set-group-id file", filter, SYS_openat, AT_FDCWD, "own", O_WRONLY | O_TMPFILE, 02755),
        {"fork a child of its parent", filter, [] { return forks(CLONE_PARENT); }},
        call("type into a terminal", filter, SYS_ioctl, STDIN_FILENO, TIOCSTI | upperHalf, "x"),
        call("make a stream in disguise", filter, SYS_socket, AF_UNIX | upperHalf, SOCK_STREAM | upperHalf, 0),
        call("make the launchers' socket", filter, SYS_socket, AF_UNIX, linux_::launchSocketAddress.type, 0),
    };
    const auto refuseAlways = [&](auto... numbers) {
        (attempts.push_back(call("call " + std::to_string(numbers), filter, numbers, -1L, -1L, -1L, -1L, -1L)), ...);
    };
    // What reaches other processes.
    refuseAlways(SYS_ptrace, SYS_process_vm_readv, SYS_process_vm_writev, SYS_pidfd_getfd);
    // What Landlock lets everybody do, by path or by a descriptor for reading.
    refuseAlways(SYS_getxattr, SYS_listxattr, SYS_fgetxattr, SYS_fsetxattr, SYS_fremovexattr, SYS_fchmod, SYS_fchmodat,
                 452, SYS_fchown, SYS_utimensat, SYS_inotify_add_watch);
    // What a number names that can be guessed, and keys.
    refuseAlways(SYS_msgsnd, SYS_msgctl, SYS_semctl, SYS_shmctl, SYS_keyctl);
    // Namespaces and roots, and what hides what it is asked for.
    refuseAlways(SYS_unshare, SYS_mount, SYS_chroot, SYS_clone3, SYS_openat2, SYS_io_uring_setup);
    const int current = linux_::landlockVersion();
    for (const int version : {0, 1, 2, 3, current}) {
        // A rule set of an older kernel, and no rules at all, must keep what they can.
        if (version > current) continue;
        inConfined("keyboard", version, [&] {
            const std::set<int> refusals{EPERM, EACCES, EXDEV, ENOSYS};
            for (const auto& [name, keeper, make] : attempts) {
                if ((version == 0 && keeper == landlock) || (version >= 6 && keeper == signalFilter)) continue;
                const int error = make();
                EXPECT_TRUE(keeper == nobody ? error == 0 : refusals.contains(error)) << name << ": " << error;
            }
        });
    }
    if (current == 0) GTEST_SKIP() << "this kernel has no Landlock: what it would keep was not tried";
}

TEST_F(Confinement, ProfilesDifferInWhatTheyAllow) {
    const int version = linux_::landlockVersion();
    for (const auto& [profile, mayConnect, mayServe] :
         {std::tuple("keyboard", false, false), {"plugin", true, false}, {"network-filter", true, true}})
        inConfined(profile, version, [&] {
            EXPECT_EQ(listen(Descriptor(socket(AF_INET, SOCK_STREAM, 0)).get(), 1) == 0, mayServe);
            for (const int family : {AF_INET, AF_INET6})
                for (const int type : {SOCK_STREAM, SOCK_DGRAM}) EXPECT_EQ(socket(family, type, 0) >= 0, mayConnect);
            EXPECT_EQ(open("/etc/hosts", O_RDONLY) >= 0, mayConnect || version == 0);
        });
}

TEST_F(Confinement, SetUserIdProgramsGainNothing) {
    if (geteuid() != 0) GTEST_SKIP() << "only root makes a set-user-id program of root";
    const std::string program = at("Bundle/WhoAmI");
    fs::copy_file("/usr/bin/id", program);
    chmod(program.c_str(), 04755);
    chmod(_scratch.path().c_str(), 0755);
    const auto userOf = [&](bool isConfined) {
        const auto prepare = [&] {
            return support::becomeOrdinaryUser() && (!isConfined || confine("plugin", linux_::landlockVersion()));
        };
        return support::ChildProgram(program, prepare, {"-u"}).readTo('\n');
    };
    EXPECT_EQ(userOf(false), "0") << "the program does what it is there for";
    EXPECT_EQ(userOf(true), std::to_string(support::ordinaryUser));
}
