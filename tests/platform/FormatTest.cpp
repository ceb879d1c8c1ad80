#include "platform/Format.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <limits>

namespace {

using namespace platform;

struct Described {
    mutable int asked = 0;
    std::string description() const {
        ++asked;
        return "described";
    }
};
enum class Choice : std::uint8_t { second = 1 };

const UUID uuid = *UUID::parse("01234567-89AB-CDEF-0123-456789ABCDEF");

// What must not compile. `formatFault` is what a `FormatString` asks.
static_assert(formatFault<int>("%d%%") == FormatFault::none);
static_assert(formatFault<>("%d") == FormatFault::tooFewArguments);
static_assert(formatFault<int, int>("%d") == FormatFault::tooManyArguments);
static_assert(formatFault<int>("%s") == FormatFault::wrongKindOfArgument);
static_assert(formatFault<int>("%@") == FormatFault::wrongKindOfArgument);
static_assert(formatFault<int>("%p") == FormatFault::wrongKindOfArgument);
static_assert(formatFault<std::string>("%d") == FormatFault::wrongKindOfArgument);
static_assert(formatFault<Described>("%s") == FormatFault::wrongKindOfArgument);
static_assert(formatFault<std::string>("%{uuid_t}.16P") == FormatFault::wrongKindOfArgument);
static_assert(formatFault<UUID>("%{uuid_t}.8P") == FormatFault::unknownConversion);
static_assert(formatFault<UUID>("%.16P") == FormatFault::unknownOption);
static_assert(formatFault<std::string>("%{errno}s") == FormatFault::unknownOption);
static_assert(formatFault<std::string>("%{pubic}s") == FormatFault::unknownOption);
static_assert(formatFault<std::string>("%{public@") == FormatFault::unknownOption);
static_assert(formatFault<std::string>("%ls") == FormatFault::unknownConversion);
static_assert(formatFault<double>("%f") == FormatFault::unknownConversion);
static_assert(formatFault<int>("%") == FormatFault::unknownConversion);
static_assert(formatFault<std::vector<int>>("%@") == FormatFault::unprintableArgument);
static_assert(formatFault<std::optional<int>>("%@") == FormatFault::unprintableArgument);

TEST(Format, IntegersOfEveryWidthKeepTheirValue) {
    constexpr auto smallest = std::numeric_limits<std::int64_t>::min();
    constexpr auto largest = std::numeric_limits<std::uint64_t>::max();
    EXPECT_EQ(format("%d %i %lld %d", std::int8_t{-1}, -2, smallest, largest),
              "-1 -2 -9223372036854775808 18446744073709551615");
    EXPECT_EQ(format("%u %lu %llu %zu", std::uint16_t{65535}, 5L, largest, sizeof(char)),
              "65535 5 18446744073709551615 1");
    EXPECT_EQ(format("%u 0x%lx %llx %x", -1, 48879, largest, std::int8_t{-1}), "4294967295 0xbeef ffffffffffffffff ff");
    EXPECT_EQ(format("%d %d %d", true, Choice::second, 'a'), "1 1 97");
    EXPECT_EQ(format("%{errno}d", ENOENT), "[2: No such file or directory]");
    EXPECT_EQ(format("no arguments, 100%%"), "no arguments, 100%");
}

TEST(Format, TextsAndObjectsPrintThemselves) {
    const std::string text = "text";
    const char* none = nullptr;
    EXPECT_EQ(format("%s %s %s %s", text, std::string_view("view"), "literal", none), "text view literal (null)");
    EXPECT_EQ(format("%@ %@ %s", text, std::optional<std::string>(), std::optional<std::string>("in")),
              "text (null) in");
    EXPECT_EQ(format("%@ %{uuid_t}.16P %{uuid_t}.16P", uuid, uuid, uuid.bytes),
              "01234567-89AB-CDEF-0123-456789ABCDEF 01234567-89AB-CDEF-0123-456789ABCDEF "
              "01234567-89AB-CDEF-0123-456789ABCDEF");
    EXPECT_EQ(format("%@ %@", URL::file("/a b"), Error{"Domain", 4}), "file:///a%20b Domain error 4");
    EXPECT_EQ(format("%@ %@ %@", Value("string"), Value(), Failure(Error{"D", 1, "failed"})), "string (null) failed");
    const Array array{Value(1), Value("two")};
    EXPECT_EQ(format("%@", array), Value(array).description());

    const Described object;
    const auto shared = std::make_shared<const Described>();
    const std::unique_ptr<Described> gone;
    EXPECT_EQ(format("%@ %@ %@ %@ %@", object, &object, shared, gone, nullptr),
              "described described described (null) (null)");
    EXPECT_EQ(format("%@ %@", std::vector<std::shared_ptr<const Described>>{shared, nullptr}, std::vector<UUID>()),
              "(described, (null)) ()");
}

TEST(Format, AddressesAreThoseOfTheObjects) {
    const auto shared = std::make_shared<Described>();
    const std::string address = format("%p", static_cast<void*>(shared.get()));
    EXPECT_EQ(address.substr(0, 2), "0x");
    EXPECT_EQ(format("%p %p %p", shared, shared.get(), *shared), address + " " + address + " " + address);
    EXPECT_EQ(format("%p", std::shared_ptr<Described>()), "(null)");
    const std::string text = uuid.text();
    EXPECT_EQ(format("(%public}@)", text), "(" + format("%p", static_cast<const void*>(&text)) + "ublic}@)");
}

TEST(Format, LongListsAreCut) {
    const std::vector<std::string> list(100'000, "an element");
    const std::string text = format("%@", list);
    EXPECT_LT(text.size(), maximumListDescription + 100);
    EXPECT_TRUE(text.ends_with(", ...)"));
    // An earlier argument does not use up the room of a later one, and texts are never cut here.
    const std::string large(2 * maximumListDescription, 'x');
    EXPECT_EQ(format("%@%@", large, std::vector<std::string>{"a", "b"}), large + "(a, b)");
}

TEST(Format, HiddenArgumentsAreNotAskedForTheirText) {
    const Described object;
    const std::vector<FormatArgument> arguments{FormatArgument(object), FormatArgument(object), FormatArgument("text"),
                                                FormatArgument("text"), FormatArgument(7),      FormatArgument(8),
                                                FormatArgument(uuid)};
    constexpr std::string_view text = "%@ %{public}@ %s %{public}s %d %{private}d %{uuid_t}.16P";
    EXPECT_EQ(formatArguments(text, arguments, PrivateArguments::hidden),
              "<private> described <private> text 7 <private> 01234567-89AB-CDEF-0123-456789ABCDEF");
    EXPECT_EQ(object.asked, 1);
    EXPECT_EQ(formatArguments(text, arguments, PrivateArguments::shown),
              "described described text text 7 8 01234567-89AB-CDEF-0123-456789ABCDEF");
}

} // namespace
