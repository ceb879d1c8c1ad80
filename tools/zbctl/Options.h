#pragma once

#include <CLI/App.hpp>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>

/// Options whose values are taken as exactly what was typed, or refused.
namespace zbctl {

/// Decimal, or hexadecimal after "0x". The library's own conversion lets what is out of range wrap around or stop at
/// the largest number.
void addNumber(CLI::App* verb, const std::string& name, std::function<void(std::uint64_t)> set,
               const std::string& description);

/// Tells an empty text from none. `text` must outlive the parsing.
CLI::Option* addText(CLI::App* verb, const std::string& name, std::optional<std::string>& text,
                     const std::string& description);

} // namespace zbctl
