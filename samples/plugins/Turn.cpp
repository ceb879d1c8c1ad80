// Turns the plain PGM picture on standard input by a quarter: to the left, or to the right with the argument "right".

#include <cstddef>
#include <iostream>
#include <string_view>
#include <vector>

int main(int argc, char** argv) {
    const bool right = argc > 1 && std::string_view(argv[1]) == "right";
    std::string magic;
    std::size_t width = 0;
    std::size_t height = 0;
    unsigned maximum = 0;
    std::cin >> magic >> width >> height >> maximum;
    constexpr std::size_t largestSide = 8192; // keeps the picture below a quarter of a gigabyte
    if (!std::cin || magic != "P2" || width > largestSide || height > largestSide) {
        std::cerr << "Turn: no plain PGM picture\n";
        return 1;
    }
    std::vector<unsigned> pixels(width * height);
    for (unsigned& pixel : pixels) std::cin >> pixel;
    if (!std::cin) {
        std::cerr << "Turn: the picture ends early\n";
        return 1;
    }
    std::cout << "P2\n" << height << ' ' << width << '\n' << maximum << '\n';
    for (std::size_t row = 0; row < width; ++row) {
        for (std::size_t column = 0; column < height; ++column) {
            const std::size_t x = right ? row : width - 1 - row;
            const std::size_t y = right ? height - 1 - column : column;
            std::cout << pixels[y * width + x] << (column + 1 == height ? '\n' : ' ');
        }
    }
    return 0;
}
