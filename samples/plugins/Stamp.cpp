// Writes the date before each line of standard input.

#include <ctime>
#include <iomanip>
#include <iostream>
#include <string>

int main() {
    const std::time_t now = std::time(nullptr);
    std::tm date{};
    gmtime_r(&now, &date);
    for (std::string line; std::getline(std::cin, line);) std::cout << std::put_time(&date, "%F ") << line << '\n';
    return std::cin.bad() ? 1 : 0;
}
