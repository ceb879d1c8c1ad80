#include "platform/Url.h"

#include <gtest/gtest.h>

namespace {

using platform::URL;
using namespace std::string_literals;

TEST(URLFile, EscapesAllButUnreservedCharactersAndKeepsThePath) {
    const std::pair<std::string, std::string> cases[] = {
        {"/~a-b_c.d%e#f?g:h@i Ü", "file:///~a-b_c.d%25e%23f%3Fg%3Ah%40i%20%C3%9C"},
        {"/", "file:///"},
        {"/\xFF\n", "file:///%FF%0A"}};
    for (const auto& [path, text] : cases)
        for (const URL& url : {URL::file(path), URL::file(path + "//"), *URL::parse(text)})
            EXPECT_TRUE(url.absoluteString() == text && url.path() == path && url.isFile() && url == URL::file(path))
                << text;
    // A relative path is no file URL and never reads as a scheme.
    const URL relative = URL::file("file:///etc");
    EXPECT_EQ(relative.path(), "file:///etc");
    EXPECT_FALSE(relative.isFile() || URL::parse(relative.absoluteString())->isFile() || URL::file("").isFile());
    // What is appended is escaped as it is, before a query.
    const URL appended = URL::parse("file:///a/?q")->appending("../b c%41?/");
    EXPECT_EQ(appended.absoluteString(), "file:///a/../b%20c%2541%3F/?q");
    EXPECT_EQ(appended.path(), "/a/../b c%41?");
}

TEST(URLParse, TellsFileURLsFromOthers) {
    const std::tuple<std::string, bool, std::string> cases[] = {
        {"file:///a%2Fb%2f", true, "/a/b"},    {"file:/a", true, "/a"},
        {"FILE://LocalHost/a/", true, "/a"},   {"file://elsewhere/a", false, "/a"},
        {"file:///a?query#x", true, "/a"},     {"file:///Ü", true, "/Ü"},
        {"file://localhost", false, ""},       {"file:a", false, "a"},
        {"https://host/a%20b", false, "/a b"}, {"1file:///a", false, "1file:///a"},
        {"files:///a", false, "/a"},           {"/a/b", false, "/a/b"},
    };
    for (const auto& [text, isFile, path] : cases) {
        const auto url = URL::parse(text);
        EXPECT_TRUE(url && url->isFile() == isFile && url->path() == path && url->absoluteString() == text) << text;
    }
    for (const auto& text : {""s, "file:///a b"s, "file:///\0a"s, "file:///\x7F"s, "file:///%"s, "file:///%4"s,
                             "file:///%4g"s, "file:///%g4"s, "a%00b"s, "file:///a?%zz"s})
        EXPECT_FALSE(URL::parse(text)) << text;
}

} // namespace
