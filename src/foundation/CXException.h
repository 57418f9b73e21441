#pragma once

#include <stdexcept>
#include <string>

namespace rolvane {

// The platform's base exception. "Caught" in this code base means `const CXException&`; anything else passes on.
// The name groups failures for programs ("CXDatabaseException"), the reason is a sentence for people: what happened,
// to what, and what to do.
class CXException : public std::exception {
public:
    CXException(std::string name, std::string reason)
        : _name(std::move(name)), _reason(std::move(reason)), _what(_name + ": " + _reason) {}

    const std::string& name() const { return _name; }
    const std::string& reason() const { return _reason; }
    std::string description() const { return _reason; }
    const char* what() const noexcept override { return _what.c_str(); }

private:
    std::string _name, _reason, _what;
};

// Names in use.
inline constexpr const char* kCXInvalidArgumentException = "CXInvalidArgumentException";
inline constexpr const char* kCXRangeException = "CXRangeException";
inline constexpr const char* kCXMutationException = "CXMutationException"; // a collection changed while it was walked
inline constexpr const char* kCXDatabaseException = "CXDatabaseException";
inline constexpr const char* kCXPreferencesException = "CXPreferencesException";
inline constexpr const char* kCXPropertyListException = "CXPropertyListException";
inline constexpr const char* kCXArchiveException = "CXArchiveException";
inline constexpr const char* kCXFileException = "CXFileException";
inline constexpr const char* kCXNetworkException = "CXNetworkException";

} // namespace rolvane
