#include "foundation/PropertyList.h"

#include "foundation/Base64.h"
#include "foundation/Utf8.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <fmt/format.h>

namespace rolvane {

namespace {

constexpr std::string_view kHead =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<!DOCTYPE plist PUBLIC \"-//Rolvane//DTD PLIST 1.0//EN\" \"http://rolvane.net/DTDs/PropertyList-1.0.dtd\">\n"
    "<plist version=\"1.0\">\n";
constexpr std::string_view kTail = "</plist>\n";
constexpr size_t kBytesPerLine = 57; // 76 base64 digits

constexpr std::string_view replacement(char c) {
    switch (c) {
    case '&': return "&amp;";
    case '<': return "&lt;";
    case '>': return "&gt;";
    case '\r': return "&#13;"; // a parser turns a bare one into a line feed
    default: return {};
    }
}

constexpr std::array<bool, 256> kIsReplaced = [] {
    std::array<bool, 256> replaced{};
    for (size_t i = 0; i < replaced.size(); ++i) replaced[i] = !replacement(static_cast<char>(i)).empty();
    return replaced;
}();

class Writer {
public:
    std::string document(const Value& v) {
        _out = kHead;
        value(v);
        _out += kTail;
        return std::move(_out);
    }

private:
    void value(const Value& v) {
        switch (v.type()) {
        case ValueType::absent: refuse("there is an absent value");
        case ValueType::boolean: line(v.boolean() ? "<true/>" : "<false/>"); break;
        case ValueType::integer: integer(v.integer()); break;
        case ValueType::real: real(v.real()); break;
        case ValueType::string: text("string", v.string()); break;
        case ValueType::date: date(*v.date()); break;
        case ValueType::data: data(v.data()); break;
        case ValueType::array: array(*v.arrayIf()); break;
        case ValueType::dictionary: dictionary(*v.dictionaryIf()); break;
        }
    }

    void array(const Array& a) {
        enter(a.empty() ? "<array/>" : "<array>");
        if (a.empty()) return leave();
        for (const Value& item : a) value(item);
        leave("</array>");
    }

    void dictionary(const Dictionary& d) {
        enter(d.empty() ? "<dict/>" : "<dict>");
        if (d.empty()) return leave();
        for (const auto& [key, item] : d) {
            text("key", key);
            _path.push_back(&key);
            value(item);
            _path.pop_back();
        }
        leave("</dict>");
    }

    void enter(std::string_view tag) {
        line(tag);
        if (++_depth > PropertyListLimits{}.maxDepth)
            refuse(fmt::format("containers are nested deeper than {}", PropertyListLimits{}.maxDepth));
    }
    void leave(std::string_view tag = {}) {
        --_depth;
        if (!tag.empty()) line(tag);
    }

    void integer(int64_t n) {
        std::array<char, 24> digits;
        const auto end = std::to_chars(digits.begin(), digits.end(), n).ptr;
        element("integer", {digits.data(), static_cast<size_t>(end - digits.data())});
    }

    void real(double d) {
        if (std::isnan(d)) return element("real", "nan");
        if (std::isinf(d)) return element("real", d > 0 ? "+infinity" : "-infinity");
        std::array<char, 32> digits;
        const auto end = std::to_chars(digits.begin(), digits.end(), d).ptr;
        element("real", {digits.data(), static_cast<size_t>(end - digits.data())});
    }

    void date(Date d) {
        if (!d.isRepresentable()) refuse("there is a date outside the years 1 to 9999");
        element("date", d.toISO8601());
    }

    void data(const Bytes& b) {
        line("<data>");
        for (size_t i = 0; i < b.size(); i += kBytesPerLine) {
            indent();
            appendBase64(b.data() + i, std::min(kBytesPerLine, b.size() - i), _out);
            _out += '\n';
        }
        line("</data>");
    }

    void text(std::string_view tag, const std::string& s) {
        if (const auto fault = xmlTextFault(s))
            refuse(fmt::format("a {} cannot be written: {}", tag == "key" ? "key" : "string", *fault));
        open(tag);
        escaped(s);
        close(tag);
    }

    void escaped(std::string_view s) {
        size_t done = 0;
        for (size_t i = 0; i < s.size(); ++i) {
            if (!kIsReplaced[static_cast<unsigned char>(s[i])]) continue;
            _out.append(s, done, i - done);
            _out += replacement(s[i]);
            done = i + 1;
        }
        _out.append(s, done);
    }

    void element(std::string_view tag, std::string_view content) {
        open(tag);
        _out += content;
        close(tag);
    }
    void open(std::string_view tag) {
        indent();
        _out += '<';
        _out += tag;
        _out += '>';
    }
    void close(std::string_view tag) {
        _out += "</";
        _out += tag;
        _out += ">\n";
    }
    void line(std::string_view whole) {
        indent();
        _out += whole;
        _out += '\n';
    }
    void indent() { _out.append(static_cast<size_t>(_depth), '\t'); }

    [[noreturn]] void refuse(const std::string& reason) const {
        std::string path;
        for (const std::string* key : _path) path += (path.empty() ? "" : "/") + *key;
        throw CXException(kCXPropertyListException,
                          fmt::format("the property list cannot be written: {}{}", reason,
                                      path.empty() ? " at the top" : " below \"" + path + "\""));
    }

    std::string _out;
    std::vector<const std::string*> _path; // keys on the way to the value at hand
    int _depth = 0;
};

} // namespace

std::string PropertyList::toXML(const Value& value) {
    return Writer().document(value);
}

} // namespace rolvane
