#include "platform/linux/SystemLog.h"
#include "platform/linux/Descriptor.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <fstream>
#include <sched.h>
#include <string>
#include <string_view>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

using platform::LogHandle;
using platform::LogLevel;
using platform::linux_::Descriptor;
using platform::linux_::maximumLineLength;
using platform::linux_::printableLine;

/// A Linux log whose lines the test reads from a pipe.
class PipeLog {
public:
    explicit PipeLog(std::string_view settings = "")
        : _pipe(makePipe()),
          log("zbd", settings, _pipe.write.get(), platform::linux_::SystemLog::Destination::descriptor) {}

    /// The lines written since the last call, without their ends.
    std::vector<std::string> lines() {
        std::string bytes(1 << 20, '\0');
        const ssize_t count = ::read(_pipe.read.get(), bytes.data(), bytes.size());
        bytes.resize(count > 0 ? static_cast<std::size_t>(count) : 0);
        std::vector<std::string> lines;
        for (std::size_t at = 0; at < bytes.size();) {
            const std::size_t end = bytes.find('\n', at);
            lines.push_back(bytes.substr(at, end - at));
            at = end == std::string::npos ? bytes.size() : end + 1;
        }
        return lines;
    }
    /// Levels, categories and messages, without the times.
    std::vector<std::string> untimedLines() {
        std::vector<std::string> all = lines();
        for (std::string& line : all) line.erase(0, line.find(' ') + 1);
        return all;
    }
    void closeReader() { _pipe.read.reset(); }
    int reader() const { return _pipe.read.get(); }

private:
    struct Pipe {
        Descriptor read;
        Descriptor write;
    };
    static Pipe makePipe() {
        int ends[2] = {-1, -1};
        EXPECT_EQ(::pipe2(ends, O_CLOEXEC), 0);
        EXPECT_EQ(::fcntl(ends[0], F_SETFL, O_NONBLOCK), 0); // the test's end only; the log's may block
        return {Descriptor(ends[0]), Descriptor(ends[1])};
    }
    Pipe _pipe;

public:
    platform::linux_::SystemLog log;
};

/// A twin with the settings of a fresh Linux log.
struct TwinLog {
    TwinLog() { log.setLevel("", LogLevel::info); }
    support::FakeSystemLog log;
    std::vector<std::string> untimedLines() {
        std::vector<std::string> all;
        for (const auto& line : log.lines())
            all.push_back(std::string(line.level == LogLevel::debug      ? "debug"
                                      : line.level == LogLevel::info     ? "info"
                                      : line.level == LogLevel::standard ? "default"
                                                                         : "error") +
                          (line.category.empty() ? "" : " [" + line.category + "]") + " " + line.message);
        log.clear();
        return all;
    }
};

void logAllLevels(LogHandle& handle) {
    handle.debug("d");
    handle.info("i");
    handle.notice("n");
    handle.error("e");
}

using Lines = std::vector<std::string>;

template <class T> class SystemLogs : public testing::Test {
protected:
    T platform;
};
using Implementations = testing::Types<PipeLog, TwinLog>;
TYPED_TEST_SUITE(SystemLogs, Implementations);

TYPED_TEST(SystemLogs, HandlesAreMadeOncePerCategory) {
    std::vector<LogHandle*> handles(8);
    std::vector<std::thread> threads;
    for (auto& handle : handles)
        threads.emplace_back([&] { handle = this->platform.log.createHandle("com.example", "ops"); });
    for (auto& thread : threads) thread.join();
    for (LogHandle* handle : handles) EXPECT_EQ(handle, handles[0]);
    EXPECT_NE(handles[0], nullptr);
    EXPECT_NE(this->platform.log.createHandle("com.example", "cx"), handles[0]);
}

TYPED_TEST(SystemLogs, LevelsAreSetForAllOrForOneCategory) {
    platform::SystemLog& log = this->platform.log;
    LogHandle& ops = *log.createHandle("com.example", "ops");
    LogHandle& cx = *log.createHandle("com.example", "cx");
    logAllLevels(ops);
    log.setLevel("cx", LogLevel::debug);
    logAllLevels(cx);
    logAllLevels(log.defaultHandle());
    EXPECT_EQ(this->platform.untimedLines(),
              (Lines{"info [ops] i", "default [ops] n", "error [ops] e", "debug [cx] d", "info [cx] i",
                     "default [cx] n", "error [cx] e", "info i", "default n", "error e"}));
    log.setLevel("", LogLevel::error); // default and error lines cannot be turned off
    logAllLevels(ops);
    logAllLevels(cx);
    EXPECT_EQ(this->platform.untimedLines(),
              (Lines{"default [ops] n", "error [ops] e", "default [cx] n", "error [cx] e"}));
}

TEST(LinuxSystemLog, SettingsChooseLevelsAndPrivacy) {
    struct Case {
        const char* settings;
        bool opsDebug;
        bool cxDebug;
        bool cxInfo;
        const char* argument;
    };
    for (const Case& each : std::vector<Case>{{"", false, false, true, "<private>"},
                                              {"debug", true, true, true, "<private>"},
                                              {"cx=debug,ops=info,private", false, true, true, "secret"},
                                              {"cx=default,,private", false, false, false, "secret"},
                                              {"debug,cx=info", true, false, true, "<private>"}}) {
        SCOPED_TRACE(each.settings);
        PipeLog pipe(each.settings);
        LogHandle& ops = *pipe.log.createHandle("com.example", "ops");
        LogHandle& cx = *pipe.log.createHandle("com.example", "cx");
        EXPECT_EQ(ops.isEnabled(LogLevel::debug), each.opsDebug);
        EXPECT_EQ(cx.isEnabled(LogLevel::debug), each.cxDebug);
        EXPECT_EQ(cx.isEnabled(LogLevel::info), each.cxInfo);
        cx.error("%s %{public}s %d", "secret", "open", 1);
        EXPECT_EQ(pipe.untimedLines(), Lines{"error [cx] " + std::string(each.argument) + " open 1"});
    }
    EXPECT_EQ(PipeLog("debug,loud").untimedLines(), Lines{"error NORDANE_LOG: \"loud\" is not understood"});
}

TEST(LinuxSystemLog, MessagesStayOnOneTimedLine) {
    PipeLog pipe("private");
    LogHandle& ops = *pipe.log.createHandle("com.example", "ops");
    ops.notice("path %s", "a\n2025-01-01T00:00:00.000000Z error [ops] forged\x1b[2J");
    ops.notice("%s", std::string(1'000'000, 'x'));
    Lines lines = pipe.lines();
    ASSERT_EQ(lines.size(), 2U);
    for (char& c : lines[0]) c = c >= '0' && c <= '9' ? '0' : c; // any time will do
    EXPECT_EQ(lines[0], "0000-00-00T00:00:00.000000Z default [ops] "
                        "path a\\n0000-00-00T00:00:00.000000Z error [ops] forged\\x0b[0J");
    EXPECT_EQ(lines[1].size() + 1, maximumLineLength);
    EXPECT_TRUE(lines[1].ends_with("x..."));
}

TEST(LinuxSystemLog, PrintableLineEscapesAndCuts) {
    struct Case {
        std::string_view message;
        std::size_t limit;
        std::string_view expected;
    };
    using namespace std::string_view_literals;
    for (const Case& each : std::vector<Case>{
             {"gr\u00fc\u00df \u20ac \\ \"", 100, "gr\u00fc\u00df \u20ac \\ \""},
             {"\n\r\t\0\x7f"sv, 100, "\\n\\x0d\\t\\x00\\x7f"},
             {"\u0080\u009b\u00a0", 100, "\\x80\\x9b\u00a0"},     // control characters in two bytes, and none
             {"\xff\xc3(\xe2\x82", 100, "\\xff\\xc3(\\xe2\\x82"}, // broken UTF-8
             {"abcdef", 6, "abcdef"},
             {"abcdefg", 6, "abc..."},
             {"ab\u20ac", 5, "ab\u20ac"},
             {"ab\u20acd", 6, "ab\u20acd"},
             {"ab\u20acde", 6, "ab..."}, // a character is not cut in two
             {"\x01\x02\x03", 12, "\\x01\\x02\\x03"},
             {"\x01\x02\x03", 11, "\\x01\\x02..."},
         })
        EXPECT_EQ(printableLine(each.message, each.limit), each.expected);
}

TEST(LinuxSystemLog, ReadersThatAreGoneOrStandStillStopNothing) {
    PipeLog pipe;
    ::fcntl(pipe.reader(), F_SETPIPE_SZ, 4096);
    const std::string message(1000, 'x');
    for (int i = 0; i < 100; ++i) pipe.log.defaultHandle().error("%{public}s", message); // does not hang
    EXPECT_LT(pipe.lines().size(), 100U);
    pipe.log.defaultHandle().error("heard again");
    EXPECT_EQ(pipe.untimedLines(), Lines{"error heard again"});

    pipe.closeReader();
    pipe.log.defaultHandle().error("to nobody"); // SIGPIPE has its default action
    sigset_t signals;
    sigpending(&signals);
    EXPECT_EQ(sigismember(&signals, SIGPIPE), 0);
    pthread_sigmask(SIG_BLOCK, nullptr, &signals);
    EXPECT_EQ(sigismember(&signals, SIGPIPE), 0);
}

/// Logs to a stand-in for the journal's socket, in a file-system view of this process's own. Never returns.
[[noreturn]] void logToOwnJournal() {
    constexpr int noNamespaces = 77;
    const bool isRoot = ::geteuid() == 0;
    const std::string user = "0 " + std::to_string(::geteuid()) + " 1";
    const std::string group = "0 " + std::to_string(::getegid()) + " 1";
    if (::unshare(isRoot ? CLONE_NEWNS : CLONE_NEWUSER | CLONE_NEWNS) != 0) ::_exit(noNamespaces);
    if (!isRoot) {
        std::ofstream("/proc/self/setgroups") << "deny";
        std::ofstream("/proc/self/uid_map") << user;
        std::ofstream("/proc/self/gid_map") << group;
    }
    if (::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
        ::mount("tmpfs", "/run", "tmpfs", 0, nullptr) != 0)
        ::_exit(noNamespaces);
    ::mkdir("/run/systemd", 0755);
    ::mkdir("/run/systemd/journal", 0755);
    const int journal = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{AF_UNIX, "/run/systemd/journal/socket"};
    if (::bind(journal, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) ::_exit(1);

    // A file instead of a terminal, as a service has it.
    const int file = ::open("/dev/null", O_WRONLY | O_CLOEXEC);
    platform::linux_::SystemLog log("zbd", "", file);
    log.createHandle("com.example", "ops")->error("one\ntwo %d", 3);
    std::string datagram(4096, '\0');
    const ssize_t size = ::recv(journal, datagram.data(), datagram.size(), MSG_DONTWAIT);
    datagram.resize(size > 0 ? static_cast<std::size_t>(size) : 0);
    for (const char* field : {"MESSAGE=one\\ntwo 3\n", "PRIORITY=3\n", "SYSLOG_IDENTIFIER=zbd\n",
                              "SUBSYSTEM=com.example\n", "CATEGORY=ops\n"})
        if (("\n" + datagram).find(std::string("\n") + field) == std::string::npos) {
            std::fprintf(stderr, "no %s in %s", field, datagram.c_str());
            ::_exit(1);
        }
    ::_exit(0);
}

TEST(LinuxSystemLog, TheJournalGetsFields) {
    GTEST_FLAG_SET(death_test_style, "threadsafe"); // namespaces are for processes of one thread
    bool isSkipped = false;
    EXPECT_EXIT(
        logToOwnJournal(),
        [&](int status) {
            isSkipped = WIFEXITED(status) && WEXITSTATUS(status) == 77;
            return isSkipped || (WIFEXITED(status) && WEXITSTATUS(status) == 0);
        },
        "");
    if (isSkipped) GTEST_SKIP() << "this process may not make namespaces";
}

} // namespace
