#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace platform {

/// A location: the text of a URL, and for a file URL the file-system path it names.
/// Paths are bytes as the file system has them; in the text all but unreserved characters are percent-encoded.
class URL {
public:
    /// The URL of a file-system path. A trailing separator (other than the root's own) is not kept.
    static URL file(std::string_view path);

    /// Parses URL text. None when it holds control characters or blanks, or a broken percent escape, or an
    /// escaped NUL. Text without a scheme is a relative URL: it parses, but is no file URL.
    static std::optional<URL> parse(std::string_view text);

    /// True for the scheme "file" with an absolute path and no host or the host "localhost".
    bool isFile() const { return _isFile; }

    /// The decoded path, without a trailing separator.
    const std::string& path() const { return _path; }

    /// The URL's whole text.
    std::string absoluteString() const;

    /// This URL with `component` behind a separator, as written: ".." and further separators are not resolved.
    URL appending(std::string_view component) const;

    friend bool operator==(const URL& left, const URL& right) {
        return left._path == right._path && left._text == right._text;
    }

private:
    URL(std::string text, std::string path, bool isFile);

    // Empty where it is what `file` makes of the path: the records of thousands of bundles have locations.
    std::string _text;
    std::string _path;
    bool _isFile;
};

} // namespace platform
