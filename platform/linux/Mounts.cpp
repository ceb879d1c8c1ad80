#include "platform/linux/Mounts.h"

#include "platform/linux/DirectoryFiles.h"

#include <fstream>
#include <sstream>

namespace platform::linux_ {

namespace {

/// Blanks, line ends and backslashes stand in the table as a backslash and three octal digits.
std::string unescaped(const std::string& field) {
    std::string text;
    for (std::size_t i = 0; i < field.size(); ++i) {
        if (field[i] != '\\' || i + 3 >= field.size()) {
            text += field[i];
            continue;
        }
        int code = 0;
        for (int digit = 0; digit < 3; ++digit) code = 8 * code + (field[++i] - '0');
        text += static_cast<char>(code);
    }
    return text;
}

} // namespace

std::string mountsAtAndBelow(const std::string& path) {
    std::string found;
    std::ifstream table("/proc/self/mountinfo");
    for (std::string line; std::getline(table, line);) {
        std::istringstream fields(line);
        std::string number;
        std::string parent;
        std::string device;
        std::string root;
        std::string point;
        fields >> number >> parent >> device >> root >> point;
        if (isAtOrBelow(unescaped(point), path)) found += number + ' ' + device + ' ' + root + ' ' + point + '\n';
    }
    return found;
}

} // namespace platform::linux_
