#pragma once

#include "platform/PropertyList.h"
#include "tools/zbctl/Session.h"

#include <iosfwd>
#include <string>
#include <string_view>

/// What people see.
namespace zbctl {

/// One line of text: control characters, which a manifest may hold and a terminal would obey, become escapes.
std::string printable(std::string_view text);

void printJson(std::ostream& out, const platform::Value& value);

/// The value as an indented tree; a dictionary's plain values come first, in one column.
void printTree(std::ostream& out, const platform::Value& value);

/// A plug-in form: a line that names the plug-in, then the tree.
void printForm(std::ostream& out, const platform::Dictionary& form);

/// What a stored election means.
inline constexpr std::uint64_t electionNone = 0;
inline constexpr std::uint64_t electionUse = 1;
inline constexpr std::uint64_t electionIgnore = 2;

/// Plug-in forms as a table with a line for each.
void printPlugIns(std::ostream& out, const platform::Array& forms);

/// For requests whose success has no content: reports the answer, and prints an empty dictionary for scripts.
ExitStatus finish(bool json, const platform::ReplyOrError& answer);

/// Sends out what was printed on standard output. False, and a complaint, when some of it is lost: what a full disk
/// swallowed must not pass for success.
bool flushOutput();

/// "zbctl: " and the text, on standard error.
void complain(std::string_view text);

} // namespace zbctl
