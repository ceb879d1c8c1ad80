#include "platform/linux/LinuxPlatform.h"
#include "tests/support/ChildProcess.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

// In children, since the log is set once and for all.

namespace {

TEST(LinuxPlatform, FillsStandardDescriptorsThatAreClosed) {
    for (int missing = 1; missing < 8; ++missing) { // a bit for each
        const auto isMissing = [&](int number) { return (missing >> number & 1) != 0; };
        const int wrong = support::resultInChild([&] {
            const int other = open("/dev/zero", O_RDWR | O_CLOEXEC); // tells those that were open from the null device
            for (int number = 0; number < 3; ++number) {
                dup2(other, number);
                if (isMissing(number)) close(number);
            }
            const platform::linux_::LinuxPlatform constructed;
            struct stat status{};
            for (int number = 0; number < 3; ++number) { // without close-on-exec: programs started here need them too
                if (fstat(number, &status) != 0 || fcntl(number, F_GETFD) != 0 ||
                    (status.st_rdev == makedev(1, 3)) != isMissing(number))
                    return 10 + number;
            }
            return 0;
        });
        EXPECT_EQ(wrong, 0) << missing;
    }
}

} // namespace
