#pragma once

#include <exception>
#include <string>

namespace rolvane::cardbook {

inline constexpr const char* kDavSpace = "DAV:";
inline constexpr const char* kCardSpace = "urn:ietf:params:xml:ns:carddav";

// Why a request is refused: the status, and the precondition that the body names (RFC 6352 section 6.3.2, RFC 6578
// section 3.2, RFC 3253 section 1.6), "" for none. Thrown wherever it is found out; nothing has been changed then.
class Refused : public std::exception {
public:
    Refused(int status, std::string words) : _status(status), _words(std::move(words)) {}
    Refused(int status, const char* space, std::string precondition, std::string words, std::string content = {})
        : _status(status), _space(space), _precondition(std::move(precondition)), _words(std::move(words)),
          _content(std::move(content)) {}

    int status() const { return _status; }
    const char* space() const { return _space; }
    const std::string& precondition() const { return _precondition; }
    const std::string& words() const { return _words; }
    const std::string& content() const { return _content; } // of the precondition's element, as XML
    const char* what() const noexcept override { return _words.c_str(); }

private:
    int _status;
    const char* _space = kDavSpace;
    std::string _precondition, _words, _content;
};

} // namespace rolvane::cardbook
