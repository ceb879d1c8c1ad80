#include "platform/linux/SystemLog.h"
#include "platform/linux/Descriptor.h"
#include "tests/support/ChildProcess.h"
#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

#include <csignal>
#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <thread>

namespace {

using platform::LogHandle;
using platform::LogLevel;
using platform::linux_::Descriptor;
using platform::linux_::maximumLineLength;
using platform::linux_::printableLine;

using Lines = std::vector<std::string>;

/// A Linux log whose lines the test reads from a pipe.
class PipeLog {
public:
    explicit PipeLog(std::string_view settings = "")
        : log("zbd", settings, _write.get(), platform::linux_::SystemLog::Destination::descriptor) {}

    /// The lines written since the last call, without their ends.
    Lines lines() {
        std::string bytes(1 << 20, '\0');
        const ssize_t count = ::read(reader.get(), bytes.data(), bytes.size());
        std::istringstream stream(bytes.substr(0, count > 0 ? static_cast<std::size_t>(count) : 0));
        Lines lines;
        for (std::string line; std::getline(stream, line);) lines.push_back(line);
        return lines;
    }
    /// Levels, categories and messages, without the times.
    Lines untimedLines() {
        Lines all = lines();
        for (std::string& line : all) line.erase(0, line.find(' ') + 1);
        return all;
    }

    Descriptor reader; // does not block; the log's end may

private:
    Descriptor _write = makePipe();
    Descriptor makePipe() {
        int ends[2] = {-1, -1};
        EXPECT_EQ(::pipe2(ends, O_CLOEXEC), 0);
        EXPECT_EQ(::fcntl(ends[0], F_SETFL, O_NONBLOCK), 0);
        reader = Descriptor(ends[0]);
        return Descriptor(ends[1]);
    }

public:
    platform::linux_::SystemLog log;
};

/// A twin with the settings of a fresh Linux log.
struct TwinLog {
    TwinLog() { log.setLevel("", LogLevel::info); }
    support::FakeSystemLog log;
    Lines untimedLines() {
        static const char* const levels[] = {"debug", "info", "default", "error"};
        Lines all;
        for (const auto& line : log.lines())
            all.push_back(levels[static_cast<int>(line.level)] +
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

template <class T> class SystemLogs : public testing::Test {
protected:
    T platform;
};
using Implementations = testing::Types<PipeLog, TwinLog>;
TYPED_TEST_SUITE(SystemLogs, Implementations);

TYPED_TEST(SystemLogs, HandlesAreMadeOncePerCategory) {
    LogHandle* const handle = this->platform.log.createHandle("com.example", "ops");
    LogHandle* same = nullptr;
    std::thread([&] { same = this->platform.log.createHandle("com.example", "ops"); }).join();
    EXPECT_EQ(same, handle);
    EXPECT_NE(this->platform.log.createHandle("com.example", "cx"), handle);
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
    const struct {
        const char* settings;
        bool opsDebug, cxDebug, cxInfo;
        const char* argument;
    } cases[] = {
        {"", false, false, true, "<private>"},
        {"debug", true, true, true, "<private>"},
        {"cx=debug,ops=info,private", false, true, true, "secret"},
        {"cx=default,,private", false, false, false, "secret"},
        {"debug,cx=info", true, false, true, "<private>"},
    };
    for (const auto& [settings, opsDebug, cxDebug, cxInfo, argument] : cases) {
        SCOPED_TRACE(settings);
        PipeLog pipe(settings);
        LogHandle& cx = *pipe.log.createHandle("com.example", "cx");
        EXPECT_EQ(pipe.log.createHandle("com.example", "ops")->isEnabled(LogLevel::debug), opsDebug);
        EXPECT_EQ(cx.isEnabled(LogLevel::debug), cxDebug);
        EXPECT_EQ(cx.isEnabled(LogLevel::info), cxInfo);
        cx.error("%s %{public}s %d", "secret", "open", 1);
        EXPECT_EQ(pipe.untimedLines(), Lines{"error [cx] " + std::string(argument) + " open 1"});
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
    using namespace std::string_literals;
    const struct {
        std::string message;
        std::size_t limit;
        std::string expected;
    } cases[] = {
        {"gr\u00fc\u00df \u20ac \\ \"", 100, "gr\u00fc\u00df \u20ac \\ \""},
        {"\n\r\t\0\x7f"s, 100, "\\n\\x0d\\t\\x00\\x7f"},
        {"\u0080\u009b\u00a0", 100, "\\x80\\x9b\u00a0"},     // control characters in two bytes, and none
        {"\xff\xc3(\xe2\x82", 100, "\\xff\\xc3(\\xe2\\x82"}, // broken UTF-8
        {"abcdef", 6, "abcdef"},
        {"abcdefg", 6, "abc..."},
        {"ab\u20acd", 6, "ab\u20acd"},
        {"ab\u20acde", 6, "ab..."}, // a character is not cut in two
        {"\x01\x02\x03", 12, "\\x01\\x02\\x03"},
        {"\x01\x02\x03", 11, "\\x01\\x02..."},
    };
    for (const auto& [message, limit, expected] : cases) EXPECT_EQ(printableLine(message, limit), expected);
}

TEST(LinuxSystemLog, ReadersThatAreGoneOrStandStillStopNothing) {
    PipeLog pipe;
    ::fcntl(pipe.reader.get(), F_SETPIPE_SZ, 4096);
    const std::string message(1000, 'x');
    for (int i = 0; i < 100; ++i) pipe.log.defaultHandle().error("%{public}s", message); // does not hang
    EXPECT_LT(pipe.lines().size(), 100U);
    pipe.log.defaultHandle().error("heard again");
    EXPECT_EQ(pipe.untimedLines(), Lines{"error heard again"});

    pipe.reader.reset();
    pipe.log.defaultHandle().error("to nobody"); // SIGPIPE has its default action
    sigset_t signals;
    sigpending(&signals);
    EXPECT_EQ(sigismember(&signals, SIGPIPE), 0);
    pthread_sigmask(SIG_BLOCK, nullptr, &signals);
    EXPECT_EQ(sigismember(&signals, SIGPIPE), 0);
}

// In a file-system view of the child's own, where the test stands in for the journal.
TEST(LinuxSystemLog, TheJournalGetsFields) {
    const int result = support::resultInChild([] {
        if (::unshare(CLONE_NEWNS) != 0 || ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
            ::mount("tmpfs", "/run", "tmpfs", 0, nullptr) != 0)
            return 9;
        ::mkdir("/run/systemd", 0755);
        ::mkdir("/run/systemd/journal", 0755);
        const Descriptor journal(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
        sockaddr_un address{AF_UNIX, "/run/systemd/journal/socket"};
        if (::bind(journal.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return 2;

        const Descriptor file(::open("/dev/null", O_WRONLY | O_CLOEXEC)); // no terminal, as a service has it
        platform::linux_::SystemLog log("zbd", "", file.get());
        log.createHandle("com.example", "ops")->error("one\ntwo %d", 3);
        std::string datagram(4096, '\0');
        if (::recv(journal.get(), datagram.data(), datagram.size(), MSG_DONTWAIT) < 0) return 3;
        for (const char* field : {"\nMESSAGE=one\\ntwo 3\n", "\nPRIORITY=3\n", "\nSYSLOG_IDENTIFIER=zbd\n",
                                  "\nSUBSYSTEM=com.example\n", "\nCATEGORY=ops\n"})
            if (("\n" + datagram).find(field) == std::string::npos) {
                std::fprintf(stderr, "no %s in %s", field, datagram.c_str());
                return 1;
            }
        return 0;
    });
    if (result == 9) GTEST_SKIP() << "may not mount";
    EXPECT_EQ(result, 0);
}

} // namespace
