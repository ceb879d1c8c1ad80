// Counts lines, words and bytes of the text on standard input.

#include <cctype>
#include <cstdint>
#include <iostream>

int main() {
    std::uint64_t lines = 0;
    std::uint64_t words = 0;
    std::uint64_t bytes = 0;
    bool insideWord = false;
    for (char c = 0; std::cin.get(c); ++bytes) {
        const bool space = std::isspace(static_cast<unsigned char>(c)) != 0;
        if (c == '\n') ++lines;
        if (!space && !insideWord) ++words;
        insideWord = !space;
    }
    std::cout << lines << " lines, " << words << " words, " << bytes << " bytes\n";
    return std::cin.bad() ? 1 : 0;
}
