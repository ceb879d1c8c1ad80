#include "platform/Url.h"
#include "platform/Uuid.h"

#include <gtest/gtest.h>

namespace {

using platform::URL;
using platform::UUID;

TEST(URLFile, EscapesAllButUnreservedCharactersAndKeepsThePath) {
    const struct {
        std::string path, text, kept;
    } cases[] = {
        {"/Applications/Über uns.app", "file:///Applications/%C3%9Cber%20uns.app", "/Applications/Über uns.app"},
        {"/~a-b_c.d%e#f?g:h@i", "file:///~a-b_c.d%25e%23f%3Fg%3Ah%40i", "/~a-b_c.d%e#f?g:h@i"},
        {"/a/b//", "file:///a/b", "/a/b"},
        {"/", "file:///", "/"},
        {"/\xFF\n", "file:///%FF%0A", "/\xFF\n"},
    };
    for (const auto& [path, text, kept] : cases) {
        const URL url = URL::file(path);
        EXPECT_EQ(url.absoluteString(), text);
        EXPECT_EQ(url.path(), kept);
        EXPECT_TRUE(url.isFile());
        const auto parsed = URL::parse(text);
        ASSERT_TRUE(parsed) << text;
        EXPECT_EQ(parsed->path(), kept);
        EXPECT_TRUE(*parsed == url);
    }
}

TEST(URLFile, RelativePathIsNoFileURLAndNeverReadsAsAScheme) {
    const URL url = URL::file("file:///etc");
    EXPECT_FALSE(url.isFile());
    EXPECT_EQ(url.path(), "file:///etc");
    EXPECT_FALSE(URL::parse(url.absoluteString())->isFile());
    EXPECT_FALSE(URL::file("").isFile());
}

TEST(URLParse, TellsFileURLsFromOthers) {
    const struct {
        std::string text;
        bool isFile;
        std::string path;
    } cases[] = {
        {"file:///a/b", true, "/a/b"},         {"file:/a", true, "/a"},           {"FILE://LocalHost/a/", true, "/a"},
        {"file:///a%2Fb%2f", true, "/a/b"},    {"file:///a?query#x", true, "/a"}, {"file:///Ü", true, "/Ü"},
        {"file://elsewhere/a", false, "/a"},   {"file://localhost", false, ""},   {"file:a", false, "a"},
        {"https://host/a%20b", false, "/a b"}, {"/a/b", false, "/a/b"},           {"files:///a", false, "/a"},
        {"1file:///a", false, "1file:///a"},   {"?file:///a", false, ""},
    };
    for (const auto& [text, isFile, path] : cases) {
        const auto url = URL::parse(text);
        ASSERT_TRUE(url) << text;
        EXPECT_EQ(url->isFile(), isFile) << text;
        EXPECT_EQ(url->path(), path) << text;
        EXPECT_EQ(url->absoluteString(), text);
    }
}

TEST(URLParse, RefusesBlanksControlCharactersAndBrokenEscapes) {
    using namespace std::string_literals;
    for (const auto& text :
         {""s, "file:///a b"s, "file:///a\n"s, "file:///a\tb"s, "file:///\0a"s, "file:///\x7F"s, "file:///%"s,
          "file:///%4"s, "file:///%4g"s, "file:///%g4"s, "file:///%00"s, "a%00b"s, "file:///a?%zz"s})
        EXPECT_FALSE(URL::parse(text)) << text;
}

TEST(URLAppending, AppendsAsWritten) {
    const struct {
        std::string base, component, text, path;
    } cases[] = {
        {"file:///a/", "b c", "file:///a/b%20c", "/a/b c"},
        {"file:///", "b", "file:///b", "/b"},
        {"file:///a", "../b//c", "file:///a/../b//c", "/a/../b//c"},
        {"file:///a", "/b", "file:///a//b", "/a//b"},
        {"file:///a", "b/", "file:///a/b/", "/a/b"},
        {"file:///a", "%41?", "file:///a/%2541%3F", "/a/%41?"},
        {"file:///a?q", "b", "file:///a/b?q", "/a/b"},
    };
    for (const auto& [base, component, text, path] : cases) {
        const URL url = URL::parse(base)->appending(component);
        EXPECT_EQ(url.absoluteString(), text);
        EXPECT_EQ(url.path(), path);
        EXPECT_TRUE(url.isFile());
    }
}

TEST(UUIDParse, ReadsTheTextFormInEitherCaseAndNothingElse) {
    const std::string text = "0F1E2D3C-4B5A-6978-8796-A5B4C3D2E1F0";
    const auto uuid = UUID::parse(text);
    ASSERT_TRUE(uuid);
    EXPECT_EQ(uuid->bytes[0], 0x0F);
    EXPECT_EQ(uuid->text(), text);
    EXPECT_EQ(UUID::parse("0f1e2d3c-4b5a-6978-8796-a5b4c3d2e1f0"), uuid);

    for (const std::string& wrong : {std::string(), text + "0", "{" + text.substr(1), text.substr(0, 35)})
        EXPECT_FALSE(UUID::parse(wrong)) << wrong;
    for (std::size_t i = 0; i < text.size(); ++i) {
        std::string broken = text;
        broken[i] = broken[i] == '-' ? '0' : '-';
        EXPECT_FALSE(UUID::parse(broken)) << broken;
    }
}

TEST(UUIDRandom, IsOfVersion4AndDiffersEachTime) {
    const UUID uuid = UUID::random();
    EXPECT_EQ(uuid.text()[14], '4');
    EXPECT_NE(std::string("89AB").find(uuid.text()[19]), std::string::npos);
    EXPECT_NE(uuid, UUID::random());
}

} // namespace
