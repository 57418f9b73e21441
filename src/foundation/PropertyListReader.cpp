#include "foundation/PropertyList.h"

#include "foundation/Base64.h"
#include "foundation/Paths.h"
#include "foundation/PropertyListText.h"
#include "foundation/Utf8.h"
#include "foundation/XmlError.h"

#include <charconv>
#include <climits>
#include <cstring>
#include <exception>
#include <fmt/format.h>
#include <libxml/SAX2.h>
#include <libxml/parser.h>
#include <libxml/parserInternals.h>
#include <limits>
#include <memory>
#include <mutex>

namespace rolvane {

namespace {

using Text = std::string_view;

Text viewOf(const xmlChar* s) {
    return s ? Text(reinterpret_cast<const char*>(s)) : Text();
}

// What a message shows of text that a stranger wrote.
std::string shown(Text text) {
    std::string out;
    for (const char c : text.substr(0, 60)) out += static_cast<unsigned char>(c) < 0x20 || c == 0x7f ? '?' : c;
    return out + (text.size() > 60 ? "..." : "");
}

Text trimmed(Text text) {
    const auto isSpace = [](char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; };
    while (!text.empty() && isSpace(text.front())) text.remove_prefix(1);
    while (!text.empty() && isSpace(text.back())) text.remove_suffix(1);
    return text;
}

enum class Element { plist, dict, array, key, string, integer, real, date, data, yes, no };

std::optional<Element> elementNamed(Text name) {
    static constexpr std::pair<Text, Element> kNames[] = {
        {"key", Element::key},         {"string", Element::string}, {"dict", Element::dict},  {"array", Element::array},
        {"integer", Element::integer}, {"data", Element::data},     {"date", Element::date},  {"real", Element::real},
        {"true", Element::yes},        {"false", Element::no},      {"plist", Element::plist}};
    for (const auto& [known, element] : kNames)
        if (name == known) return element;
    return std::nullopt;
}

// Decimal, or hexadecimal after 0x, with an optional sign.
std::optional<int64_t> integerFrom(Text text) {
    text = trimmed(text);
    const bool minus = text.starts_with('-');
    if (minus || text.starts_with('+')) text.remove_prefix(1);
    const bool hex = text.starts_with("0x") || text.starts_with("0X");
    if (hex) text.remove_prefix(2);
    uint64_t n = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), n, hex ? 16 : 10);
    const uint64_t most = static_cast<uint64_t>(std::numeric_limits<int64_t>::max()) + (minus ? 1 : 0);
    if (text.empty() || error != std::errc() || end != text.data() + text.size() || n > most) return std::nullopt;
    return static_cast<int64_t>(minus ? 0 - n : n);
}

std::optional<double> realFrom(Text text) {
    text = trimmed(text);
    if (text.starts_with('+')) {
        text.remove_prefix(1);
        if (text.starts_with('-')) return std::nullopt;
    }
    double d = 0; // from_chars knows nan, inf and infinity in any case of letters
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), d);
    if (text.empty() || error != std::errc() || end != text.data() + text.size()) return std::nullopt;
    return d;
}

// Builds a Value from the parser's events. The first failure is kept, stops the parser, and is thrown at the end: no
// exception crosses the parser's own frames.
class Builder {
public:
    explicit Builder(const PropertyListLimits& limits) : _limits(limits) { _stack.reserve(16); }

    void attach(xmlParserCtxt* parser) { _parser = parser; }
    const std::exception_ptr& failure() const { return _failure; }
    Value result() const { return _result; }
    bool isComplete() const { return bool(_result); }

    template <class Step>
    void guarded(Step step) {
        if (_failure) return;
        try {
            step();
        } catch (...) {
            _failure = std::current_exception();
            xmlStopParser(_parser);
        }
    }

    void begin(Text name, bool hasPrefix) {
        const auto element = hasPrefix ? std::nullopt : elementNamed(name);
        if (!element) refuse(fmt::format("unknown element <{}>", shown(name)));
        if (_leaf) refuse(fmt::format("<{}> inside a value that has text only", name));
        if (!_inPlist) {
            if (*element != Element::plist) refuse(fmt::format("the outermost element is <{}>, not <plist>", name));
            _inPlist = true;
            return;
        }
        if (*element == Element::plist) refuse("<plist> inside <plist>");
        checkPlace(*element);
        if (*element == Element::dict || *element == Element::array)
            open(*element);
        else
            _leaf = *element;
    }

    void end() {
        if (_leaf) {
            const Element element = *_leaf;
            _leaf.reset();
            if (element == Element::key)
                takeKey();
            else
                add(leafValue(element));
            _text.clear();
        } else if (!_stack.empty()) {
            closeContainer();
        } else if (!_result) {
            refuse("there is no value in it");
        }
    }

    void characters(Text text) {
        if (_leaf)
            _text += text;
        else if (!trimmed(text).empty())
            refuse(fmt::format("text \"{}\" outside a value", shown(trimmed(text))));
    }

    void documentType(Text name, bool hasExternalId) {
        if (name != "plist") refuse(fmt::format("the document type is \"{}\", not \"plist\"", shown(name)));
        if (!hasExternalId) refuse("the document type has no external identifier");
        if (_parser->input && _parser->input->cur && *_parser->input->cur == '[') refuseDeclaration();
    }

    void entity(Text name) { refuse(fmt::format("the entity \"{}\" is not one of the five predefined", shown(name))); }
    void refuseDeclaration() { refuse("the document type has an internal subset"); }
    void parserError(const xmlError* error) { throw CXException(kCXPropertyListException, cxReasonOfXmlError(error)); }

    [[noreturn]] void refuse(const std::string& reason) const {
        throw CXException(kCXPropertyListException, fmt::format("line {}: {}", xmlSAX2GetLineNumber(_parser), reason));
    }

private:
    struct Container {
        bool isDictionary;
        bool hasKey = false;
        std::string key;
        Dictionary dictionary;
        std::vector<Value> items;
    };

    void checkPlace(Element element) const {
        if (_stack.empty()) {
            if (_result) refuse("there is more than one value in it");
            if (element == Element::key) refuse("a key outside a dictionary");
            return;
        }
        const Container& in = *_stack.back();
        if (element == Element::key && !in.isDictionary) refuse("a key inside an array");
        if (element == Element::key && in.hasKey) refuse(fmt::format("the key \"{}\" has no value", shown(in.key)));
        if (element != Element::key && in.isDictionary && !in.hasKey) refuse("a value without a key in a dictionary");
    }

    void open(Element element) {
        if (_stack.size() >= static_cast<size_t>(std::max(_limits.maxDepth, 0)))
            refuse(fmt::format("containers are nested deeper than {}", _limits.maxDepth));
        _stack.push_back(std::make_unique<Container>(Container{element == Element::dict, false, {}, {}, {}}));
    }

    void closeContainer() {
        Container& in = *_stack.back();
        if (in.hasKey) refuse(fmt::format("the key \"{}\" has no value", shown(in.key)));
        Value made = in.isDictionary ? Value(in.dictionary) : Value(Array(std::move(in.items)));
        _stack.pop_back();
        add(std::move(made));
    }

    void takeKey() {
        checkText();
        _stack.back()->key = std::exchange(_text, {});
        _stack.back()->hasKey = true;
    }

    void add(Value v) {
        if (_stack.empty()) {
            _result = std::move(v);
            return;
        }
        Container& in = *_stack.back();
        if (!in.isDictionary) {
            in.items.push_back(std::move(v));
            return;
        }
        in.hasKey = false;
        if (!in.dictionary.setIfNew(std::move(in.key), std::move(v)))
            refuse(fmt::format("the key \"{}\" is there twice", shown(in.key)));
    }

    Value leafValue(Element element) {
        switch (element) {
        case Element::string: checkText(); return std::exchange(_text, {});
        case Element::integer: return required(integerFrom(_text), "an integer of 64 bits");
        case Element::real: return required(realFrom(_text), "a real number");
        case Element::date: return required(Date::fromISO8601(trimmed(_text)), "a date");
        case Element::data: return required(fromBase64(_text), "base64");
        default:
            if (!trimmed(_text).empty()) refuse("text inside a truth value");
            return element == Element::yes;
        }
    }

    template <class T>
    Value required(std::optional<T> value, const char* kind) const {
        if (!value) refuse(fmt::format("\"{}\" is not {}", shown(trimmed(_text)), kind));
        return std::move(*value);
    }

    // Whatever the parser lets pass: what is read can be written again.
    void checkText() const {
        if (const auto fault = xmlTextFault(_text)) refuse("a text cannot be used: " + *fault);
    }

    const PropertyListLimits& _limits;
    xmlParserCtxt* _parser = nullptr;
    std::vector<std::unique_ptr<Container>> _stack;
    std::optional<Element> _leaf;
    std::string _text;
    bool _inPlist = false;
    Value _result;
    std::exception_ptr _failure;
};

Builder& builderOf(void* context) {
    return *static_cast<Builder*>(static_cast<xmlParserCtxt*>(context)->_private);
}

extern "C" {

void startElement(void* c, const xmlChar* name, const xmlChar* prefix, const xmlChar*, int, const xmlChar**, int, int,
                  const xmlChar**) {
    Builder& b = builderOf(c);
    b.guarded([&] { b.begin(viewOf(name), prefix != nullptr); });
}
void endElement(void* c, const xmlChar*, const xmlChar*, const xmlChar*) {
    Builder& b = builderOf(c);
    b.guarded([&] { b.end(); });
}
void characters(void* c, const xmlChar* text, int size) {
    Builder& b = builderOf(c);
    b.guarded([&] { b.characters({reinterpret_cast<const char*>(text), static_cast<size_t>(size)}); });
}
void internalSubset(void* c, const xmlChar* name, const xmlChar* publicId, const xmlChar* systemId) {
    Builder& b = builderOf(c);
    b.guarded([&] { b.documentType(viewOf(name), publicId || systemId); });
}
xmlEntity* getEntity(void* c, const xmlChar* name) {
    Builder& b = builderOf(c);
    b.guarded([&] { b.entity(viewOf(name)); });
    return nullptr;
}
void reference(void* c, const xmlChar* name) {
    Builder& b = builderOf(c);
    b.guarded([&] { b.entity(viewOf(name)); });
}
void entityDecl(void* c, const xmlChar*, int, const xmlChar*, const xmlChar*, xmlChar*) {
    Builder& b = builderOf(c);
    b.guarded([&] { b.refuseDeclaration(); });
}
void structuredError(void* c, xmlError* error) {
    if (error->level < XML_ERR_ERROR) return;
    Builder& b = builderOf(c);
    b.guarded([&] { b.parserError(error); });
}

} // extern "C"

xmlSAXHandler makeHandler() {
    xmlSAXHandler h;
    std::memset(&h, 0, sizeof h);
    h.initialized = XML_SAX2_MAGIC;
    h.startElementNs = startElement;
    h.endElementNs = endElement;
    h.characters = characters;
    h.ignorableWhitespace = characters; // the same function: the parser then need not tell the two apart
    h.cdataBlock = characters;
    h.internalSubset = internalSubset;
    h.getEntity = getEntity;
    h.getParameterEntity = getEntity;
    h.reference = reference;
    h.entityDecl = entityDecl;
    h.serror = structuredError;
    return h;
}

struct FreeParser {
    void operator()(xmlParserCtxt* p) const { xmlFreeParserCtxt(p); }
};

std::unique_ptr<xmlParserCtxt, FreeParser> makeParser(Text text, Builder& builder) {
    static std::once_flag once;
    std::call_once(once, xmlInitParser);
    std::unique_ptr<xmlParserCtxt, FreeParser> parser(
        xmlCreateMemoryParserCtxt(text.data(), static_cast<int>(text.size())));
    if (!parser) throw std::bad_alloc();
    static const xmlSAXHandler handler = makeHandler();
    // No limits of the parser's own (a photo is one long text); ours stand before and around it.
    xmlCtxtUseOptions(parser.get(), XML_PARSE_NONET | XML_PARSE_HUGE | XML_PARSE_IGNORE_ENC);
    *parser->sax = handler;
    parser->_private = &builder;
    builder.attach(parser.get());
    return parser;
}

Value parse(Text text, const PropertyListLimits& limits) {
    Builder builder(limits);
    const auto parser = makeParser(text, builder);
    xmlParseDocument(parser.get());
    if (builder.failure()) std::rethrow_exception(builder.failure());
    if (!parser->wellFormed || !builder.isComplete())
        throw CXException(kCXPropertyListException, cxReasonOfXmlError(xmlCtxtGetLastError(parser.get())));
    return builder.result();
}

} // namespace

Value PropertyList::fromXML(std::string_view text, const PropertyListLimits& limits) {
    if (text.size() > std::min<size_t>(limits.maxBytes, INT_MAX))
        throw CXException(kCXPropertyListException,
                          fmt::format("line 1: the text has {} bytes, more than the limit of {}", text.size(),
                                      std::min<size_t>(limits.maxBytes, INT_MAX)));
    std::string converted;
    return parse(preparePropertyListText(text, converted), limits);
}

Value PropertyList::fromFile(const std::string& path, const PropertyListLimits& limits) {
    const std::string text = readFile(path, limits.maxBytes);
    try {
        return fromXML(text, limits);
    } catch (const CXException& e) {
        throw CXException(e.name(), fmt::format("the property list \"{}\" cannot be read: {}", path, e.reason()));
    }
}

} // namespace rolvane
