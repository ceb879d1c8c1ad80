#pragma once

#include "tests/support/SystemLogFake.h"

#include <csignal>
#include <cstdio>

namespace support {

/// For the body of a death test: prints the lines of the fake log to standard error when the process aborts, where
/// the test can match them.
inline void printLogWhenAborted() {
    std::signal(SIGABRT, [](int) {
        for (const auto& line : processLog.lines()) std::fprintf(stderr, "%s\n", line.message.c_str());
    });
}

} // namespace support
