#include "platform/linux/ConfinementProfiles.h"
#include "platform/linux/Sandbox.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <climits>
#include <fstream>
#include <linux/fs.h>
#include <linux/keyctl.h>
#include <linux/openat2.h>
#include <sched.h>
#include <sys/inotify.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/msg.h>
#include <sys/ptrace.h>
#include <sys/resource.h>
#include <sys/sem.h>
#include <sys/shm.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <sys/xattr.h>

using namespace platform;
namespace fs = std::filesystem;

namespace {

using linux_::Descriptor;

constexpr std::uint64_t upperHalf = 1ULL << 32U; // of an argument, which the kernel does not look at

int result(long value) { return value < 0 ? errno : 0; }
/// Zero when the path can be opened, else errno.
int opens(const std::string& path, int flags = O_RDONLY) {
    return result(Descriptor(open(path.c_str(), flags | O_CLOEXEC, 0600)).get());
}
int makesSocket(std::uint64_t family, std::uint64_t type) { return result(syscall(SYS_socket, family, type, 0)); }
int makesPair(int type) {
    int pair[2];
    return result(socketpair(AF_UNIX, type, 0, pair));
}
/// Zero when the program runs, else why not.
int executes(const std::string& path) {
    return support::resultInChild([&] {
        execl(path.c_str(), path.c_str(), nullptr);
        return errno;
    });
}

/// A home, a bundle, two containers, and a listener on the loopback interface.
class Confinement : public testing::Test {
protected:
    Confinement() {
        for (const char* directory : {"home", "Bundle", "own/tmp", "other"}) fs::create_directories(at(directory));
        for (const char* file : {"home/secret", "Bundle/Resource", "other/secret"}) std::ofstream(at(file)) << file;
        fs::copy_file(fs::canonical("/bin/true"), at("Bundle/Program"));
        _bundle = Descriptor(open(at("Bundle").c_str(), O_PATH | O_CLOEXEC));
        _container = Descriptor(open(at("own").c_str(), O_PATH | O_CLOEXEC));
        _listener = Descriptor(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        _address.sin_family = AF_INET;
        _address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t size = sizeof _address;
        EXPECT_EQ(bind(_listener.get(), address(), size), 0);
        EXPECT_EQ(listen(_listener.get(), 8), 0);
        EXPECT_EQ(getsockname(_listener.get(), reinterpret_cast<sockaddr*>(&_address), &size), 0);
    }

    std::string at(const std::string& name) const { return _scratch / name; }
    const sockaddr* address() const { return reinterpret_cast<const sockaddr*>(&_address); }
    bool confine(const char* profile, int version) const {
        const linux_::OwnPlace own[] = {{_bundle.get(), linux_::readFiles | linux_::executeFiles},
                                        {_container.get(), linux_::readFiles | linux_::changeFiles}};
        return !linux_::confine(*linux_::findConfinementProfile(profile), own, version);
    }
    int connects() const {
        const Descriptor client(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        return client ? result(connect(client.get(), address(), sizeof _address)) : errno;
    }
    static int serves() {
        const Descriptor server(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        return server ? result(listen(server.get(), 1)) : errno;
    }

    support::ScratchDirectory _scratch;
    Descriptor _bundle;
    Descriptor _container;
    Descriptor _listener;
    sockaddr_in _address{};
};

enum class Keeper {
    filter,
    landlock,
    signalFilter, // before version 6; from then on Landlock, when the signal is due
    nobody,
};

struct Attempt {
    const char* name;
    Keeper keeper; // who refuses it
    std::function<int()> make;
};

bool isRefusal(int number) { return number == EPERM || number == EACCES || number == EXDEV || number == ENOSYS; }

/// What every attempt gave in a confined child of this process.
std::vector<int> resultsConfined(const std::vector<Attempt>& attempts, const std::function<bool()>& confine) {
    const std::size_t size = attempts.size() * sizeof(int);
    auto* shared = static_cast<int*>(mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0));
    std::fill_n(shared, attempts.size(), -1);
    EXPECT_EQ(support::resultInChild([&] {
                  if (!confine()) return 1;
                  for (std::size_t index = 0; index < attempts.size(); ++index) shared[index] = attempts[index].make();
                  return 0;
              }),
              0);
    std::vector<int> results(shared, shared + attempts.size());
    munmap(shared, size);
    return results;
}

} // namespace

TEST_F(Confinement, KeepsAServiceToItsOwn) {
    const pid_t parent = getpid();
    const std::string proc = "/proc/" + std::to_string(parent);
    char byte = 0;
    iovec own{&byte, 1};
    iovec foreign{&byte, 1};
    int pair[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
    const Descriptor ends[] = {Descriptor(pair[0]), Descriptor(pair[1])};
    const Descriptor resource(open(at("Bundle/Resource").c_str(), O_RDONLY | O_CLOEXEC));
    const auto makes = [&](const char* name, int flags, mode_t mode) {
        return result(Descriptor(open(at(name).c_str(), flags | O_WRONLY | O_CLOEXEC, mode)).get());
    };
    const std::vector<Attempt> attempts = {
        {"read the bundle", Keeper::nobody, [&] { return opens(at("Bundle/Resource")); }},
        {"execute the bundle's program", Keeper::nobody, [&] { return executes(at("Bundle/Program")); }},
        {"make a file in the container", Keeper::nobody, [&] { return opens(at("own/new"), O_RDWR | O_CREAT); }},
        {"open with a number in the mode's place", Keeper::nobody,
         [&] { return result(syscall(SYS_openat, AT_FDCWD, at("own/new").c_str(), O_RDONLY, 06755)); }},
        {"rename in the container", Keeper::nobody,
         [&] { return result(rename(at("own/new").c_str(), at("own/newer").c_str())); }},
        {"read libraries", Keeper::nobody, [] { return opens("/usr/lib", O_RDONLY | O_DIRECTORY); }},
        {"write to nothing", Keeper::nobody, [] { return opens("/dev/null", O_WRONLY); }},
        {"look at itself", Keeper::nobody, [] { return opens("/proc/self/maps"); }},
        {"signal itself", Keeper::nobody, [] { return result(raise(SIGCHLD)); }},
        {"be nicer", Keeper::nobody, [] { return result(setpriority(PRIO_PROCESS, 0, 1)); }},
        {"make a packet socket", Keeper::nobody, [] { return makesSocket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC); }},

        {"read the home", Keeper::landlock, [&] { return opens(at("home/secret")); }},
        {"read another container", Keeper::landlock, [&] { return opens(at("other/secret")); }},
        {"remove another's file", Keeper::landlock, [&] { return result(unlink(at("other/secret").c_str())); }},
        {"link another's file", Keeper::landlock,
         [&] { return result(link(at("other/secret").c_str(), at("own/link").c_str())); }},
        {"write to the bundle", Keeper::landlock, [&] { return opens(at("Bundle/Resource"), O_WRONLY); }},
        {"truncate the bundle", Keeper::landlock, [&] { return result(truncate(at("Bundle/Resource").c_str(), 0)); }},
        {"truncate the bundle by opening it to read", Keeper::landlock,
         [&] { return opens(at("Bundle/Resource"), O_RDONLY | O_TRUNC); }},
        {"truncate the home by opening it for nothing", Keeper::landlock,
         [&] { return opens(at("home/secret"), O_ACCMODE | O_TRUNC); }},
        {"truncate the bundle anew", Keeper::landlock,
         [&] {
             const open_how how{O_RDONLY | O_TRUNC, 0, 0};
             return result(syscall(SYS_openat2, AT_FDCWD, at("Bundle/Resource").c_str(), &how, sizeof how));
         }},
        {"read the users", Keeper::landlock, [] { return opens("/etc/passwd"); }},
        {"execute a system program", Keeper::landlock, [] { return executes("/bin/true"); }},
        {"execute a script that it made", Keeper::landlock,
         [&] {
             const std::string text = "#!/bin/true\n";
             Descriptor script(open(at("own/script").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0700));
             if (write(script.get(), text.data(), text.size()) < 0) return 0;
             script.reset();
             return executes(at("own/script"));
         }},
        {"read its parent's environment", Keeper::landlock, [&] { return opens(proc + "/environ"); }},
        {"signal its parent", Keeper::filter, [&] { return result(kill(parent, 0)); }},
        {"signal its parent's thread", Keeper::filter, [&] { return result(syscall(SYS_tgkill, parent, parent, 0)); }},

        {"have its parent signalled", Keeper::signalFilter, [&] { return result(fcntl(pair[0], F_SETOWN, parent)); }},
        {"have its parent signalled anew", Keeper::signalFilter,
         [&] {
             const f_owner_ex owner{F_OWNER_PID, parent};
             return result(fcntl(pair[0], F_SETOWN_EX, &owner));
         }},
        {"have its parent signalled by a socket's call", Keeper::signalFilter,
         [&] { return result(ioctl(pair[0], FIOSETOWN, &parent)); }},
        // A child, for some kernels let nobody trace a parent anyway. It ends with this process, which may not kill it.
        {"trace its child", Keeper::filter,
         [] {
             int life[2];
             if (pipe(life) != 0) return errno;
             const pid_t child = fork();
             if (child == 0) {
                 close(life[1]);
                 char nothing = 0;
                 _exit(static_cast<int>(read(life[0], &nothing, 1)));
             }
             return result(ptrace(PTRACE_SEIZE, child, nullptr, nullptr));
         }},
        {"read its parent's memory", Keeper::filter,
         [&] { return result(process_vm_readv(parent, &own, 1, &foreign, 1, 0)); }},
        {"take its parent's descriptors", Keeper::filter,
         [&] {
             const Descriptor process(static_cast<int>(syscall(SYS_pidfd_open, parent, 0)));
             return result(syscall(SYS_pidfd_getfd, process.get(), 0, 0));
         }},
        {"limit its parent", Keeper::filter,
         [&] {
             const rlimit limit{0, 0};
             return result(prlimit(parent, RLIMIT_CORE, &limit, nullptr));
         }},
        {"move its parent to another processor", Keeper::filter,
         [&] {
             const unsigned long processors = 1;
             return result(syscall(SYS_sched_setaffinity, parent, sizeof processors, &processors));
         }},
        {"set its parent back", Keeper::filter,
         [&] {
             const sched_param none{};
             return result(sched_setscheduler(parent, SCHED_IDLE, &none));
         }},
        {"set its parent's priority", Keeper::filter,
         [&] { return result(setpriority(PRIO_PROCESS, static_cast<id_t>(parent), 0)); }},
        {"set its group's priority", Keeper::filter, [] { return result(setpriority(PRIO_PGRP, 0, 0)); }},
        {"set its user's disk priority", Keeper::filter,
         [] { return result(syscall(SYS_ioprio_set, 3, geteuid(), 0)); }},
        {"read an attribute", Keeper::filter,
         [&] { return result(getxattr(at("home/secret").c_str(), "user.secret", nullptr, 0)); }},
        {"list attributes", Keeper::filter, [&] { return result(listxattr(at("home/secret").c_str(), nullptr, 0)); }},
        {"change a mode", Keeper::filter, [&] { return result(chmod(at("home/secret").c_str(), 0777)); }},
        {"change a mode anew", Keeper::filter,
         [&] { return result(syscall(452, AT_FDCWD, at("home/secret").c_str(), 0777, 0)); }},
        {"change the bundle's mode by descriptor", Keeper::filter,
         [&] { return result(fchmod(resource.get(), 0777)); }},
        {"change the bundle's owner by descriptor", Keeper::filter,
         [&] { return result(fchown(resource.get(), geteuid(), getegid())); }},
        {"change the bundle's times by descriptor", Keeper::filter,
         [&] { return result(futimens(resource.get(), nullptr)); }},
        {"set an attribute by descriptor", Keeper::filter,
         [&] { return result(fsetxattr(resource.get(), "user.nordane.x", "x", 1, 0)); }},
        {"remove an attribute by descriptor", Keeper::filter,
         [&] { return result(fremovexattr(resource.get(), "user.nordane.x")); }},
        {"read an attribute by descriptor", Keeper::filter,
         [&] { return result(fgetxattr(resource.get(), "user.nordane.x", nullptr, 0)); }},
        {"set the bundle's flags", Keeper::filter,
         [&] { return result(syscall(SYS_ioctl, resource.get(), FS_IOC_SETFLAGS | upperHalf, nullptr)); }},
        {"set the bundle's flags by the narrow call", Keeper::filter,
         [&] { return result(ioctl(resource.get(), FS_IOC32_SETFLAGS, nullptr)); }},
        {"set the bundle's project", Keeper::filter,
         [&] { return result(ioctl(resource.get(), FS_IOC_FSSETXATTR, nullptr)); }},
        {"make a set-user-id file", Keeper::filter, [&] { return makes("own/setuid", O_CREAT, 04755); }},
        {"make a set-group-id file without a name", Keeper::filter, [&] { return makes("own", O_TMPFILE, 02755); }},
        {"make a set-user-id file anew", Keeper::filter,
         [&] {
             const open_how how{O_WRONLY | O_CREAT, 04755, 0};
             return result(syscall(SYS_openat2, AT_FDCWD, at("own/anew").c_str(), &how, sizeof how));
         }},
        {"make a set-user-id node", Keeper::filter,
         [&] { return result(mknod(at("own/node").c_str(), S_IFREG | 04755, 0)); }},
        // Were they let through, a number that nobody has would give EINVAL, for the machine's may have owners.
        {"write to a queue by its number", Keeper::filter,
         [] { return result(msgsnd(-1, "12345678", 0, IPC_NOWAIT)); }},
        {"look for queues", Keeper::filter, [] { return result(msgctl(-1, IPC_STAT, nullptr)); }},
        {"set a semaphore by its number", Keeper::filter, [] { return result(semctl(-1, 0, SETVAL, 1)); }},
        {"remove a segment by its number", Keeper::filter, [] { return result(shmctl(-1, IPC_RMID, nullptr)); }},
        {"fork a child of its parent", Keeper::filter,
         [] {
             const long child = syscall(SYS_clone, CLONE_PARENT | SIGCHLD, nullptr, nullptr, nullptr, nullptr);
             if (child == 0) _exit(0);
             return result(child);
         }},
        {"watch the home", Keeper::filter,
         [&] { return result(inotify_add_watch(inotify_init(), at("home").c_str(), IN_CREATE)); }},
        {"make a namespace", Keeper::filter, [] { return result(unshare(CLONE_NEWUSER)); }},
        {"fork into a namespace", Keeper::filter,
         [] {
             const long child = syscall(SYS_clone, CLONE_NEWUSER | SIGCHLD, nullptr, nullptr, nullptr, nullptr);
             if (child == 0) _exit(0);
             return result(child);
         }},
        {"fork into a namespace anew", Keeper::filter, [] { return result(syscall(SYS_clone3, nullptr, 0)); }},
        {"mount", Keeper::filter, [&] { return result(mount("none", at("own").c_str(), "tmpfs", 0, nullptr)); }},
        {"change its root", Keeper::filter, [&] { return result(chroot(at("own").c_str())); }},
        {"read keys", Keeper::filter, [] { return result(syscall(SYS_keyctl, KEYCTL_GET_KEYRING_ID, -3, 0)); }},
        {"queue calls", Keeper::filter, [] { return result(syscall(SYS_io_uring_setup, 1, nullptr)); }},
        {"type into a terminal", Keeper::filter,
         [] { return result(syscall(SYS_ioctl, STDIN_FILENO, TIOCSTI | upperHalf, "x")); }},
        {"make a stream socket", Keeper::filter, [] { return makesSocket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC); }},
        {"make a stream socket in disguise", Keeper::filter,
         [] { return makesSocket(AF_UNIX | upperHalf, SOCK_STREAM | upperHalf); }},
        {"make a datagram socket", Keeper::filter, [] { return makesSocket(AF_UNIX, SOCK_DGRAM); }},
        {"make a pair of datagram sockets", Keeper::filter, [] { return makesPair(SOCK_DGRAM); }},
    };
    const int current = linux_::landlockVersion();
    for (const int version : {0, 1, 2, 3, current}) {
        // A rule set of an older kernel, and no rules at all, must keep what they can.
        if (version > current) continue;
        std::vector<Attempt> tried = attempts;
        if (version == 0) std::erase_if(tried, [](const Attempt& one) { return one.keeper == Keeper::landlock; });
        if (version >= 6) std::erase_if(tried, [](const Attempt& one) { return one.keeper == Keeper::signalFilter; });
        const auto results = resultsConfined(tried, [&] { return confine("keyboard", version); });
        for (std::size_t index = 0; index < tried.size(); ++index) {
            const bool isRight =
                tried[index].keeper == Keeper::nobody ? results[index] == 0 : isRefusal(results[index]);
            EXPECT_TRUE(isRight) << tried[index].name << " under version " << version << ": " << results[index];
        }
    }
    if (current == 0) GTEST_SKIP() << "this kernel has no Landlock: what it would keep was not tried";
}

TEST_F(Confinement, ProfilesDifferInWhatTheyAllow) {
    const std::vector<Attempt> attempts = {
        {"connect", {}, [&] { return connects(); }},
        {"serve", {}, [] { return serves(); }},
        {"send a datagram", {}, [] { return makesSocket(AF_INET6, SOCK_DGRAM); }},
        {"trust a server", {}, [] { return opens("/etc/hosts"); }},
        {"list file types", {}, [] { return opens("/usr/share/fonts", O_RDONLY | O_DIRECTORY); }},
    };
    const int version = linux_::landlockVersion();
    const struct {
        const char* profile;
        bool connects, serves, showsDocuments;
    } cases[] = {
        {"keyboard", false, false, false},           {"plugin", true, false, false},
        {"network-filter", true, true, false},       {"peekviewd", false, false, true},
        {"peekview-preview", false, false, true},    {"peekview-thumbnail", false, false, true},
        {"sketchpad-devtools", false, false, false}, {"message-filter", false, false, false},
    };
    for (const auto& [profile, mayConnect, mayServe, showsDocuments] : cases) {
        const auto results = resultsConfined(attempts, [&] { return confine(profile, version); });
        EXPECT_EQ(results[0] == 0, mayConnect) << profile;
        EXPECT_EQ(results[1] == 0, mayServe) << profile;
        EXPECT_EQ(results[2] == 0, mayConnect) << profile;
        if (version == 0) continue;
        EXPECT_EQ(results[3] == 0, mayConnect) << profile;
        if (fs::exists("/usr/share/fonts")) {
            EXPECT_EQ(results[4] == 0, showsDocuments) << profile;
        }
    }
    for (const char* name : {"", "Plugin", "plugin ", "none"}) EXPECT_EQ(linux_::findConfinementProfile(name), nullptr);
    if (version == 0) GTEST_SKIP() << "this kernel has no Landlock: files were not tried";
}

TEST_F(Confinement, SetUserIdProgramsGainNothing) {
    if (geteuid() != 0) GTEST_SKIP() << "only root makes a set-user-id program of root";
    const std::string program = at("Bundle/WhoAmI");
    fs::copy_file("/usr/bin/id", program);
    ASSERT_EQ(chmod(program.c_str(), 04755), 0);
    ASSERT_EQ(chmod(_scratch.path().c_str(), 0755), 0);
    const auto userOf = [&](bool isConfined) {
        int output[2];
        EXPECT_EQ(pipe2(output, O_CLOEXEC), 0);
        EXPECT_EQ(support::resultInChild([&] {
                      if (!support::becomeOrdinaryUser()) return 1;
                      if (isConfined && !confine("plugin", linux_::landlockVersion())) return 2;
                      dup2(output[1], STDOUT_FILENO);
                      execl(program.c_str(), program.c_str(), "-u", nullptr);
                      return 3;
                  }),
                  0);
        char text[16] = {};
        EXPECT_GT(read(output[0], text, sizeof text - 1), 0);
        close(output[0]);
        close(output[1]);
        return std::atoi(text);
    };
    EXPECT_EQ(userOf(false), 0) << "the program does what it is there for";
    EXPECT_EQ(userOf(true), static_cast<int>(support::ordinaryUser));
}

TEST_F(Confinement, TokensOpenWhatTheServiceItselfCannot) {
    linux_::Sandbox issuer{linux_::Root(_scratch.path()), linux_::SandboxRole::issuer};
    ASSERT_FALSE(issuer.startBroker());
    const auto issue = [&](const char* name) {
        return *issuer.issueFile(sandboxReadExtensionClass, at(name), SandboxFlag::canonical, "");
    };
    const std::string file = issue("home/secret");
    const std::string directory = issue("home");
    fs::create_symlink(at("other"), at("home/leaving"));
    fs::create_directory(at("home/folder"));
    EXPECT_EQ(support::resultInChild([&] {
                  const int version = linux_::landlockVersion();
                  if (!confine("keyboard", version)) return 1;
                  if (version > 0 && opens(at("home/secret")) != EACCES) return 2;
                  linux_::Sandbox host{linux_::Root(_scratch.path()), linux_::SandboxRole::consumer};
                  const auto isSecret = [](int descriptor) {
                      char text[32] = {};
                      return pread(descriptor, text, sizeof text, 0) > 0 && std::string_view(text) == "home/secret";
                  };
                  int number = 0;
                  const auto handle = host.consume(file, number);
                  if (handle < 0 || !isSecret(host.descriptor(handle))) return 3;
                  const auto below = host.consume(directory, number);
                  const auto opened = host.open(below, "secret");
                  if (!opened || !isSecret(opened->get())) return 4;
                  const std::pair<std::string, int> refused[] = {{"../other/secret", EXDEV},
                                                                 {at("other/secret"), EXDEV},
                                                                 {"leaving/secret", EXDEV},
                                                                 {"missing", ENOENT},
                                                                 {"folder", EISDIR},
                                                                 {"", EINVAL},
                                                                 {std::string(PATH_MAX, 'x'), EINVAL}};
                  for (const auto& [path, error] : refused) {
                      const auto answer = host.open(below, path);
                      if (answer || answer.error().code != error) return 5;
                  }
                  const auto notBelow = host.open(handle, "secret");
                  if (notBelow || notBelow.error().code != ENOTDIR) return 6;
                  if (host.release(below, number) != 0 || host.open(below, "secret")) return 7;
                  return 0;
              }),
              0);
}
