// Prints the CRC-32 (ISO 3309, as in Ethernet frames and PNG files) of standard input.

#include <cstdint>
#include <iomanip>
#include <iostream>

int main() {
    constexpr std::uint32_t polynomial = 0xEDB88320U;
    std::uint32_t remainder = 0xFFFFFFFFU;
    for (char c = 0; std::cin.get(c);) {
        remainder ^= static_cast<unsigned char>(c);
        for (int bit = 0; bit < 8; ++bit) remainder = (remainder >> 1U) ^ ((remainder & 1U) != 0 ? polynomial : 0U);
    }
    std::cout << std::hex << std::setw(8) << std::setfill('0') << ~remainder << '\n';
    return std::cin.bad() ? 1 : 0;
}
