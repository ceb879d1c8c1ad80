#include "Zembra/ZBLog.h"

#include "tests/support/SystemLogFake.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <thread>
#include <vector>

namespace {

TEST(Log, ConcurrentFirstUsesGetTheHandleOfTheCategory) {
    for (const auto& [channel, category] : {std::pair(&zembra::log::ops, "ops"),
                                            {zembra::log::traffic, "traffic"},
                                            {zembra::log::extension, "extension"},
                                            {zembra::log::cx, "cx"},
                                            {zembra::log::sandbox, "sandbox"}}) {
        std::vector<platform::LogHandle*> handles(4);
        std::vector<std::thread> threads;
        for (auto& handle : handles) threads.emplace_back([&, made = channel] { handle = &made(); });
        for (std::thread& thread : threads) thread.join();
        for (const platform::LogHandle* handle : handles) EXPECT_EQ(handle, handles[0]);
        EXPECT_EQ(handles[0]->category(), category);
        EXPECT_EQ(handles[0]->subsystem(), "com.nordane.Zembra");
    }
}

TEST(Log, RefusedCategoriesUseTheDefaultLog) {
    GTEST_FLAG_SET(death_test_style, "threadsafe"); // channels are made once per process, so this takes a fresh one
    EXPECT_EXIT(
        {
            support::processLog.refuse("cx");
            zembra::log::cx().info("line");
            zembra::log::cx().info("line");
            for (const auto& line : support::processLog.lines())
                std::fprintf(stderr, "<%s %d %s>", line.category.c_str(), static_cast<int>(line.level),
                             line.message.c_str());
            std::exit(0);
        },
        testing::ExitedWithCode(0), "^< 3 unable to create tracelog for category cx>< 1 line>< 1 line>$");
}

} // namespace
