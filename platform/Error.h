#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <variant>

namespace platform {

/// A failure to report: who defines the code, the code, and a text for people.
struct Error {
    std::string domain;
    std::int64_t code = 0;
    std::optional<std::string> description = std::nullopt;

    /// The description, or the domain and the code when there is none.
    std::string text() const { return description ? *description : domain + " error " + std::to_string(code); }

    friend bool operator==(const Error&, const Error&) = default;
};

/// Errors that carry an errno value in `code`.
inline constexpr const char* posixErrorDomain = "Posix";

/// A value, or the error that stands in its place. Asking for the one that is not there is a bug.
template <class T> class [[nodiscard]] Result {
public:
    Result(T value) : _content(std::in_place_index<0>, std::move(value)) {}     // NOLINT(google-explicit-constructor)
    Result(Error error) : _content(std::in_place_index<1>, std::move(error)) {} // NOLINT(google-explicit-constructor)

    explicit operator bool() const { return _content.index() == 0; }
    const T& operator*() const& { return std::get<0>(_content); }
    T& operator*() & { return std::get<0>(_content); }
    T operator*() && { return std::get<0>(std::move(_content)); }
    const T* operator->() const { return &std::get<0>(_content); }
    const Error& error() const { return std::get<1>(_content); }

private:
    std::variant<T, Error> _content;
};

/// None on success.
using Failure = std::optional<Error>;

} // namespace platform
