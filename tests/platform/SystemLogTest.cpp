#include "platform/linux/SystemLog.h"
#include "platform/linux/Descriptor.h"
#include "tests/support/ChildProcess.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

namespace {

using platform::LogHandle;
using platform::LogLevel;
using platform::linux_::Descriptor;
using platform::linux_::SystemLog;
using Lines = std::vector<std::string>;

constexpr std::string_view timeForm = "0000-00-00T00:00:00.000000Z ";

/// A log whose lines the test reads from a pipe.
class PipeLog {
    int _ends[2] = {-1, -1};
    const int _made = pipe2(_ends, O_CLOEXEC);
    const Descriptor _writer{_ends[1]};

public:
    Descriptor reader{_ends[0]}; // does not block; the log's end may
    SystemLog log;

    explicit PipeLog(std::string_view settings = "")
        : log("zbd", settings, _writer.get(), SystemLog::Destination::descriptor) {
        EXPECT_EQ(fcntl(reader.get(), F_SETFL, O_NONBLOCK), _made);
    }
    /// The lines written since the last call, without their times.
    Lines lines() {
        std::string bytes(1 << 20, '\0');
        const ssize_t count = read(reader.get(), bytes.data(), bytes.size());
        std::istringstream stream(bytes.substr(0, static_cast<std::size_t>(std::max<ssize_t>(count, 0))));
        Lines lines;
        for (std::string line; std::getline(stream, line); lines.push_back(line.substr(timeForm.size()))) {
            std::string time = line.substr(0, timeForm.size());
            std::ranges::replace_if(time, [](char c) { return c >= '0' && c <= '9'; }, '0');
            EXPECT_EQ(time, timeForm) << line;
        }
        return lines;
    }
};

TEST(SystemLog, KeepsLevelsAndPrivateArgumentsAsItIsTold) {
    PipeLog pipe("ops=info,cx=debug,,private");
    LogHandle* const ops = pipe.log.createHandle("com.example", "ops");
    LogHandle* const cx = pipe.log.createHandle("com.example", "cx");
    EXPECT_EQ(pipe.log.createHandle("com.example", "ops"), ops);
    const auto logAllLevels = [&] {
        for (LogHandle* handle : {ops, cx, &pipe.log.defaultHandle()}) {
            handle->debug("d");
            handle->info("i");
            handle->notice("n");
            handle->error("%s", "e");
        }
        return pipe.lines();
    };
    EXPECT_EQ(logAllLevels(), (Lines{"info [ops] i", "default [ops] n", "error [ops] e", "debug [cx] d", "info [cx] i",
                                     "default [cx] n", "error [cx] e", "info i", "default n", "error e"}));
    pipe.log.setLevel("", LogLevel::error); // default and error lines cannot be turned off
    EXPECT_EQ(logAllLevels(),
              (Lines{"default [ops] n", "error [ops] e", "default [cx] n", "error [cx] e", "default n", "error e"}));
    pipe.log.setLevel("cx", LogLevel::info);
    EXPECT_TRUE(cx->isEnabled(LogLevel::info) && !cx->isEnabled(LogLevel::debug) && !ops->isEnabled(LogLevel::info));

    PipeLog hiding("debug,loud");
    hiding.log.createHandle("com.example", "cx")->debug("%s %{public}s %d", "secret", "open", 1);
    EXPECT_EQ(hiding.lines(), (Lines{"error NORDANE_LOG: \"loud\" is not understood", "debug [cx] <private> open 1"}));
}

TEST(SystemLog, WritesMessagesOnOneLineOfBoundedLength) {
    PipeLog pipe("private");
    pipe.log.defaultHandle().notice("%s", "a\n2025-01-01T00:00:00.000000Z error [ops] forged\x1b[2J");
    pipe.log.defaultHandle().notice("%s", std::string(1'000'000, 'x'));
    const Lines lines = pipe.lines();
    ASSERT_EQ(lines.size(), 2U);
    EXPECT_EQ(lines[0], "default a\\n2025-01-01T00:00:00.000000Z error [ops] forged\\x1b[2J");
    EXPECT_EQ(timeForm.size() + lines[1].size() + 1, platform::linux_::maximumLineLength);
}

TEST(PrintableLine, EscapesAndCuts) {
    using namespace std::string_literals;
    const std::tuple<std::string, std::size_t, std::string> cases[] = {
        {"gr\u00fc\u00df \u20ac \\ \"", 100, "gr\u00fc\u00df \u20ac \\ \""},
        {"\n\r\t\0\x7f"s, 100, "\\n\\x0d\\t\\x00\\x7f"},
        {"\u0080\u009b\u00a0", 100, "\\x80\\x9b\u00a0"},     // control characters in two bytes, and none
        {"\xff\xc3(\xe2\x82", 100, "\\xff\\xc3(\\xe2\\x82"}, // broken UTF-8
        {"ab\u20acd", 6, "ab\u20acd"},
        {"ab\u20acde", 6, "ab..."}, // a character is not cut in two
        {"\x01\x02\x03", 12, "\\x01\\x02\\x03"},
        {"\x01\x02\x03", 11, "\\x01\\x02..."},
    };
    for (const auto& [message, limit, expected] : cases)
        EXPECT_EQ(platform::linux_::printableLine(message, limit), expected);
}

TEST(SystemLog, StopsForNoReaderThatStandsStillOrIsGone) {
    PipeLog pipe;
    fcntl(pipe.reader.get(), F_SETPIPE_SZ, 4096);
    for (int i = 0; i < 100; ++i) pipe.log.defaultHandle().error("%{public}s", std::string(1000, 'x')); // does not hang
    EXPECT_LT(pipe.lines().size(), 100U);
    pipe.log.defaultHandle().error("heard again");
    EXPECT_EQ(pipe.lines(), Lines{"error heard again"});

    pipe.reader.reset();
    pipe.log.defaultHandle().error("to nobody"); // SIGPIPE has its default action
    sigset_t pending;
    sigset_t blocked;
    sigpending(&pending);
    pthread_sigmask(SIG_BLOCK, nullptr, &blocked);
    EXPECT_FALSE(sigismember(&pending, SIGPIPE) || sigismember(&blocked, SIGPIPE));
}

// In a file-system view of the child's own, where the test stands in for the journal.
TEST(SystemLog, SendsFieldsToTheJournal) {
    const int result = support::resultInChild([] {
        if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
            mount("tmpfs", "/run", "tmpfs", 0, nullptr) != 0)
            return 99;
        mkdir("/run/systemd", 0755);
        mkdir("/run/systemd/journal", 0755);
        const Descriptor journal(socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
        sockaddr_un address{AF_UNIX, "/run/systemd/journal/socket"};
        bind(journal.get(), reinterpret_cast<sockaddr*>(&address), sizeof address);
        const Descriptor file(open("/dev/null", O_WRONLY | O_CLOEXEC)); // no terminal, as a service has it
        SystemLog("zbd", "", file.get()).createHandle("com.example", "ops")->error("one\ntwo %d", 3);
        std::string datagram(4096, '\0');
        recv(journal.get(), datagram.data(), datagram.size(), MSG_DONTWAIT);
        const char* const fields[] = {"\nMESSAGE=one\\ntwo 3\n", "\nPRIORITY=3\n", "\nSYSLOG_IDENTIFIER=zbd\n",
                                      "\nSUBSYSTEM=com.example\n", "\nCATEGORY=ops\n"};
        return static_cast<int>(std::ranges::count_if(
            fields, [&](const char* field) { return ('\n' + datagram).find(field) == std::string::npos; }));
    });
    if (result == 99) GTEST_SKIP() << "may not mount";
    EXPECT_EQ(result, 0) << "fields missing";
}

} // namespace
