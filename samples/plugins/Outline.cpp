// Prints the headings ("#", "##", ...) of the text on standard input, indented by their depth.

#include <iostream>
#include <string>

int main() {
    for (std::string line; std::getline(std::cin, line);) {
        const std::size_t depth = line.find_first_not_of('#');
        if (depth == 0 || depth == std::string::npos || line[depth] != ' ') continue;
        std::cout << std::string(2 * (depth - 1), ' ') << line.substr(depth + 1) << '\n';
    }
    return std::cin.bad() ? 1 : 0;
}
