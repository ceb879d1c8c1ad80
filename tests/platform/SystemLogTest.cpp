#include "platform/linux/SystemLog.h"
#include "platform/linux/Descriptor.h"
#include "tests/support/ChildProcess.h"

#include <algorithm>
#include <filesystem>
#include <gtest/gtest.h>
#include <regex>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/un.h>

namespace {

using platform::LogHandle;
using platform::linux_::Descriptor;
using platform::linux_::SystemLog;
using Lines = std::vector<std::string>;

/// A log whose lines the test reads from a pipe.
struct PipeLog {
    int ends[2] = {-1, -1};
    const int made = pipe2(ends, O_CLOEXEC);
    Descriptor reader{ends[0]}; // does not block; the log's end may
    const Descriptor writer{ends[1]};
    SystemLog log;

    explicit PipeLog(std::string_view settings = "")
        : log("zbd", settings, writer.get(), SystemLog::Destination::descriptor) {
        EXPECT_EQ(fcntl(reader.get(), F_SETFL, O_NONBLOCK), made);
    }
    /// The lines written since the last call, without their times.
    Lines lines() const {
        std::string bytes(1 << 20, '\0');
        const ssize_t count = read(reader.get(), bytes.data(), bytes.size());
        std::istringstream stream(bytes.substr(0, static_cast<std::size_t>(std::max<ssize_t>(count, 0))));
        const std::regex time("^[-\\d]{10}T[:\\d]{8}\\.\\d{6}Z ");
        Lines lines;
        for (std::string line; std::getline(stream, line);) lines.push_back(std::regex_replace(line, time, ""));
        return lines;
    }
};

TEST(SystemLog, KeepsLevelsAndPrivateArgumentsAsItIsTold) {
    PipeLog pipe("ops=info,cx=debug,,private");
    LogHandle* const ops = pipe.log.createHandle("com.example", "ops");
    LogHandle* const cx = pipe.log.createHandle("com.example", "cx");
    for (LogHandle* handle : {ops, cx, &pipe.log.defaultHandle()}) {
        handle->debug("d");
        handle->info("i");
        handle->notice("n");
        handle->error("%s", "e");
    }
    EXPECT_EQ(pipe.lines(), (Lines{"info [ops] i", "default [ops] n", "error [ops] e", "debug [cx] d", "info [cx] i",
                                   "default [cx] n", "error [cx] e", "info i", "default n", "error e"}));

    PipeLog hiding("debug,loud");
    hiding.log.createHandle("com.example", "cx")->debug("%s %{public}s %d", "secret", "open", 1);
    EXPECT_EQ(hiding.lines(), (Lines{"error NORDANE_LOG: \"loud\" is not understood", "debug [cx] <private> open 1"}));
}

TEST(SystemLog, WritesMessagesOnOneLineOfBoundedLength) {
    PipeLog pipe("private");
    pipe.log.defaultHandle().notice("%s",
                                    "a\n2025-01-01T00:00:00.000000Z error [ops] forged\x1b[2J \u009b\xff\r \u20ac");
    pipe.log.defaultHandle().notice("%s", std::string(1'000'000, 'x'));
    const Lines lines = pipe.lines();
    ASSERT_EQ(lines.size(), 2U);
    EXPECT_EQ(lines[0], "default a\\n2025-01-01T00:00:00.000000Z error [ops] forged\\x1b[2J \\x9b\\xff\\x0d \u20ac");
    EXPECT_EQ(std::string_view("2025-01-01T00:00:00.000000Z ").size() + lines[1].size() + 1,
              platform::linux_::maximumLineLength);
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
}

// In a file-system view of the child's own, where the test stands in for the journal.
TEST(SystemLog, SendsFieldsToTheJournal) {
    const int result = support::resultInChild([] {
        if (unshare(CLONE_NEWNS) != 0 || mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
            mount("tmpfs", "/run", "tmpfs", 0, nullptr) != 0)
            return 99;
        std::filesystem::create_directories("/run/systemd/journal");
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
