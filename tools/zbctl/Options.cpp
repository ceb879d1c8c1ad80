#include "tools/zbctl/Options.h"

#include <charconv>
#include <string_view>
#include <system_error>
#include <utility>

namespace zbctl {

namespace {

std::optional<std::uint64_t> numberOf(std::string_view text) {
    const bool hexadecimal = text.starts_with("0x") || text.starts_with("0X");
    if (hexadecimal) text.remove_prefix(2);
    const char* start = text.data();
    const char* end = start + text.size();
    std::uint64_t number = 0;
    const auto [stop, error] = std::from_chars(start, end, number, hexadecimal ? 16 : 10);
    if (error != std::errc() || stop != end) return std::nullopt;
    return number;
}

} // namespace

void addNumber(CLI::App* verb, const std::string& name, std::function<void(std::uint64_t)> set,
               const std::string& description) {
    const CLI::callback_t read = [set = std::move(set)](const CLI::results_t& texts) {
        const auto number = numberOf(texts.front());
        if (number) set(*number);
        return number.has_value();
    };
    verb->add_option(name, read, description)->type_name("NUMBER");
}

CLI::Option* addText(CLI::App* verb, const std::string& name, std::optional<std::string>& text,
                     const std::string& description) {
    const CLI::callback_t read = [&text](const CLI::results_t& texts) {
        text = texts.front();
        return true;
    };
    return verb->add_option(name, read, description)->type_name("TEXT");
}

} // namespace zbctl
