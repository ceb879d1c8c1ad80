#include "platform/Format.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>

namespace {

using namespace platform;
using enum FormatFault;

struct Described {
    mutable int asked = 0;
    std::string description() const { return "described " + std::to_string(++asked); }
};
enum class Choice : std::uint8_t { second = 1 };

const UUID uuid = *UUID::parse("01234567-89AB-CDEF-0123-456789ABCDEF");

/// Whether a `FormatString`, which asks `formatFault`, would find this fault in each of the texts.
template <class... Args> consteval bool have(FormatFault fault, std::initializer_list<std::string_view> texts) {
    return std::ranges::all_of(texts, [=](auto text) { return formatFault<Args...>(text) == fault; });
}

// What must not compile.
static_assert(have<int>(none, {"%d%%"}) && have<>(tooFewArguments, {"%d"}) && have<int, int>(tooManyArguments, {"%d"}));
static_assert(have<int>(wrongKindOfArgument, {"%s", "%@", "%p"}) && have<Described>(wrongKindOfArgument, {"%s"}));
static_assert(have<std::string>(wrongKindOfArgument, {"%d", "%{uuid_t}.16P"}));
static_assert(have<std::string>(unknownOption, {"%{errno}s", "%{pubic}s", "%{public@"}));
static_assert(have<UUID>(unknownOption, {"%.16P"}) && have<UUID>(unknownConversion, {"%{uuid_t}.8P"}));
static_assert(have<std::string>(unknownConversion, {"%ls"}) && have<double>(unknownConversion, {"%f", "%"}));
static_assert(have<std::vector<int>>(unprintableArgument, {"%@"}) &&
              have<std::optional<int>>(unprintableArgument, {"%@"}));

TEST(Format, EveryKindOfArgumentPrintsItself) {
    EXPECT_EQ(format("%d %lld %d, 100%%", std::int8_t{-1}, INT64_MIN, UINT64_MAX),
              "-1 -9223372036854775808 18446744073709551615, 100%");
    EXPECT_EQ(format("%u %u 0x%lx %x", std::uint16_t{65535}, -1, 48879, std::int8_t{-1}), "65535 4294967295 0xbeef ff");
    EXPECT_EQ(format("%d %d %d %{errno}d", true, Choice::second, 'a', ENOENT), "1 1 97 [2: No such file or directory]");
    const char* nothing = nullptr;
    EXPECT_EQ(format("%s %s %@ %s", std::string_view("view"), nothing, std::optional<std::string>(),
                     std::optional<std::string>("in")),
              "view (null) (null) in");
    EXPECT_EQ(format("%@, %{uuid_t}.16P", uuid, uuid.bytes), uuid.text() + ", " + uuid.text());
    EXPECT_EQ(format("%@ %@ %@ %@ %@", URL::file("/a b"), Error{"Domain", 4}, Failure(Error{"D", 1, "failed"}), Value(),
                     Array{1, "two"}),
              "file:///a%20b Domain error 4 failed (null) (1, two)");
    const auto shared = std::make_shared<const Described>();
    const std::vector<std::shared_ptr<const Described>> list{shared, nullptr};
    EXPECT_EQ(format("%@ %@ %@ %@ %@", Described(), shared, list, std::unique_ptr<Described>(), std::vector<UUID>()),
              "described 1 described 1 (described 2, (null)) (null) ()");
    EXPECT_LT(format("%@", std::vector<std::string>(100'000, "one")).size(), maximumListDescription + 100);
}

TEST(Format, HiddenArgumentsAreNotAskedForTheirText) {
    const Described object;
    const std::vector<FormatArgument> arguments{FormatArgument(object), FormatArgument(object), FormatArgument("text"),
                                                FormatArgument("text"), FormatArgument(7),      FormatArgument(8),
                                                FormatArgument(uuid)};
    constexpr std::string_view text = "%@ %{public}@ %s %{public}s %d %{private}d %{uuid_t}.16P";
    EXPECT_EQ(formatArguments(text, arguments, PrivateArguments::hidden),
              "<private> described 1 <private> text 7 <private> " + uuid.text());
    EXPECT_EQ(formatArguments(text, arguments, PrivateArguments::shown),
              "described 2 described 3 text text 7 8 " + uuid.text());
}

} // namespace
