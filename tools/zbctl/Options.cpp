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
    const char* end = text.data() + text.size();
    std::uint64_t number = 0;
    const auto [stop, error] = std::from_chars(text.data(), end, number, hexadecimal ? 16 : 10);
    if (error != std::errc() || stop != end) return std::nullopt;
    return number;
}

} // namespace

void addNumber(CLI::App* verb, const std::string& name, std::function<void(std::uint64_t)> set,
               const std::string& description) {
    const auto read = [name, set = std::move(set)](const std::string& text) {
        const auto number = numberOf(text);
        if (!number) throw CLI::ValidationError(name, '"' + text + "\" is not a number from 0 to 2^64-1");
        set(*number);
    };
    verb->add_option_function<std::string>(name, read, description)->type_name("NUMBER");
}

CLI::Option* addText(CLI::App* verb, const std::string& name, std::optional<std::string>& text,
                     const std::string& description) {
    return verb->add_option_function<std::string>(
        name, [&text](const std::string& given) { text = given; }, description);
}

} // namespace zbctl
