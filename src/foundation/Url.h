#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// A URL (RFC 3986), immutable, kept as the text it was parsed from: `absoluteString` gives that text back.
// Equality is of the text. Parsing refuses every character outside the RFC's set (spaces, controls, non-ASCII,
// malformed escapes), and http and https without a host.
class Url {
public:
    Url() = default;                                        // the empty URL
    static std::optional<Url> parse(std::string_view text); // nothing when there is no scheme, or on malformed text
    explicit Url(std::string_view text);                    // as parse; throws kCXInvalidArgumentException instead
    // "file:" + the percent-encoded absolute path, which throws kCXInvalidArgumentException when it is relative.
    static Url fileURL(std::string_view path);

    const std::string& absoluteString() const { return _text; }
    std::string scheme() const; // as written
    std::string host() const;   // without brackets and user information, "" when there is none
    std::optional<int> port() const;
    std::string origin() const;      // scheme://host:port in lower case with the scheme's default port made explicit
    std::string encodedPath() const; // as written, "" when there is none
    std::string path() const;        // percent-decoded
    // Decoded path components; the first one is the root "/" when the path is absolute. Empty segments are dropped.
    std::vector<std::string> pathComponents() const;

    std::string cxLastComponent() const; // decoded; "" for the root or an empty path
    // Appends one component, percent-encoded so that it stays one whatever it holds: '/' becomes %2F, and a component
    // "." or ".." becomes %2E or %2E%2E. One slash stands between, none at the end; query and fragment are dropped.
    // An empty component (it would name the container itself) throws kCXInvalidArgumentException, as does an empty URL.
    Url cxURLByAppendingComponent(std::string_view component) const;
    // Without trailing slash but for the root, which stays; query and fragment are dropped.
    Url cxURLByDeletingLastComponent() const;
    // The local path of a file URL. kCXInvalidArgumentException when it is no file URL of this machine, when its path
    // is relative, or when a decoded component is "." or "..", or holds '/' or a zero byte: no name leaves its
    // directory.
    std::string filePath() const;
    Url withScheme(std::string_view scheme) const;

    friend bool operator==(const Url&, const Url&) = default;
    friend const std::string& description(const Url& u) { return u._text; }

    static std::string percentDecode(std::string_view text);          // malformed escapes stay as they are
    static std::string percentEncodeComponent(std::string_view text); // all but unreserved characters

private:
    std::string _text;
};

} // namespace rolvane
