#include "store/dav/XmlSax.h"

#include "foundation/Utf8.h"

#include <algorithm>
#include <new>

namespace rolvane {

namespace {

void silent(void*, const char*, ...) {}
void silentStructured(void*, xmlErrorPtr) {}

// Errors of an encoding libxml2 writes to standard error, by handlers of the thread and not by the
// parser's. They are other ones as long as this lives.
class Silence {
public:
    Silence()
        : _generic(xmlGenericError), _genericContext(xmlGenericErrorContext), _structured(xmlStructuredError),
          _structuredContext(xmlStructuredErrorContext) {
        xmlSetGenericErrorFunc(nullptr, silent);
        xmlSetStructuredErrorFunc(nullptr, silentStructured);
    }
    ~Silence() {
        xmlSetGenericErrorFunc(_genericContext, _generic);
        xmlSetStructuredErrorFunc(_structuredContext, _structured);
    }
    Silence(const Silence&) = delete;
    Silence& operator=(const Silence&) = delete;

private:
    xmlGenericErrorFunc _generic;
    void* _genericContext;
    xmlStructuredErrorFunc _structured;
    void* _structuredContext;
};

// libxml2 hands an ampersand in the value of an attribute over as "&#38;".
std::string plainURI(std::string_view uri) {
    constexpr std::string_view kAmpersand = "&#38;";
    std::string out;
    for (size_t at = 0; at < uri.size();) {
        out += uri[at];
        at += uri.substr(at).starts_with(kAmpersand) ? kAmpersand.size() : 1;
    }
    return out;
}

// Bodies are UTF-8 or UTF-16 (XML 1.0 section 4.3.3 asks for both); some servers write plain ASCII or Latin-1. The
// system's converters know some hundred more names, and what they make of damaged bytes depends on the pieces in which
// these come.
bool isReadable(const xmlParserCtxt& context) {
    const xmlChar* declared = context.input ? context.input->encoding : nullptr;
    if (!declared || xmlStrcasecmp(declared, BAD_CAST "us-ascii") == 0) return true;
    switch (xmlParseCharEncoding(reinterpret_cast<const char*>(declared))) {
    case XML_CHAR_ENCODING_UTF8:
    case XML_CHAR_ENCODING_UTF16LE:
    case XML_CHAR_ENCODING_UTF16BE:
    case XML_CHAR_ENCODING_8859_1:
    case XML_CHAR_ENCODING_ASCII: return true;
    default: return false;
    }
}

} // namespace

XmlSax::XmlSax(int maxDepth) : _maxDepth(static_cast<size_t>(maxDepth)) {
    _handler.initialized = XML_SAX2_MAGIC;
    _handler.startElementNs = &XmlSax::onStart;
    _handler.endElementNs = &XmlSax::onEnd;
    _handler.characters = &XmlSax::onText;
    _handler.cdataBlock = &XmlSax::onText;
    // A document type that only has a name says nothing; what one declares could change all that follows.
    _handler.entityDecl = &XmlSax::onEntity;
    _handler.attributeDecl = &XmlSax::onAttribute;
    _handler.elementDecl = &XmlSax::onElement;
    _handler.notationDecl = &XmlSax::onNotation;
    _handler.unparsedEntityDecl = &XmlSax::onUnparsed;
    _handler.reference = &XmlSax::onReference;
    _handler.warning = &silent;
    _handler.error = &silent;
    _handler.serror = &silentStructured;
    _context = xmlCreatePushParserCtxt(&_handler, this, nullptr, 0, nullptr);
    if (!_context) throw std::bad_alloc();
    xmlCtxtUseOptions(_context, XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING);
}

// Where entities are declared the parser makes a document of its own for them, which a push parser leaves to its user.
XmlSax::~XmlSax() {
    if (_context->myDoc) xmlFreeDoc(_context->myDoc);
    xmlFreeParserCtxt(_context);
}

bool XmlSax::feed(std::string_view bytes) {
    const Silence silence;
    while (_good && !bytes.empty()) {
        const size_t n = std::min<size_t>(bytes.size(), 1u << 20);
        if (xmlParseChunk(_context, bytes.data(), static_cast<int>(n), 0) != 0) _good = false;
        bytes.remove_prefix(n);
    }
    return _good;
}

bool XmlSax::finish() {
    const Silence silence;
    if (_good && xmlParseChunk(_context, nullptr, 0, 1) != 0) _good = false;
    return _good && _context->wellFormed == 1;
}

void XmlSax::refuse() {
    _good = false;
    xmlStopParser(_context);
}

void XmlSax::onStart(void* self, const xmlChar* local, const xmlChar* prefix, const xmlChar* uri, int, const xmlChar**,
                     int, int, const xmlChar**) {
    auto* sax = static_cast<XmlSax*>(self);
    if (!sax->_good) return;
    if (sax->_path.empty() && !isReadable(*sax->_context)) return sax->refuse();
    const std::string_view space = uri ? reinterpret_cast<const char*>(uri) : "";
    std::string name = reinterpret_cast<const char*>(local);
    // A name with a prefix that nobody declared, or with half of one, belongs nowhere.
    if ((prefix && !uri) || name.find(':') != std::string::npos) return sax->refuse();
    if (!sax->_begun.empty() || !isUtf8(name) || !isUtf8(space)) return sax->refuse();
    if (space != "DAV:") name = "{" + plainURI(space) + "}" + name;
    sax->_path.push_back(std::move(name));
    if (sax->_path.size() > sax->_maxDepth || !sax->opened(sax->_path)) sax->refuse();
}

void XmlSax::onEnd(void* self, const xmlChar*, const xmlChar*, const xmlChar*) {
    auto* sax = static_cast<XmlSax*>(self);
    if (!sax->_good || sax->_path.empty()) return;
    if (!sax->_begun.empty() || !sax->closed(sax->_path)) sax->refuse();
    sax->_path.pop_back();
}

void XmlSax::onText(void* self, const xmlChar* characters, int length) {
    auto* sax = static_cast<XmlSax*>(self);
    if (!sax->_good) return;
    const std::string_view piece(reinterpret_cast<const char*>(characters), static_cast<size_t>(length));
    if (!sax->isText(piece) || !sax->text(piece)) sax->refuse();
}

// The parser lets overlong forms through, which other readers take for other characters. A character may come in two
// pieces.
bool XmlSax::isText(std::string_view piece) {
    if (_begun.empty() && isUtf8(piece)) return true;
    const std::string whole = _begun + std::string(piece);
    std::string_view rest = whole;
    while (takeCodePoint(rest)) {
    }
    constexpr size_t kLongest = 4; // bytes of a character
    _begun = rest;
    return _begun.size() < kLongest;
}

void XmlSax::onReference(void* self, const xmlChar*) {
    static_cast<XmlSax*>(self)->refuse();
}

void XmlSax::onEntity(void* self, const xmlChar*, int, const xmlChar*, const xmlChar*, xmlChar*) {
    static_cast<XmlSax*>(self)->refuse();
}

void XmlSax::onAttribute(void* self, const xmlChar*, const xmlChar*, int, int, const xmlChar*, xmlEnumerationPtr tree) {
    xmlFreeEnumeration(tree); // it is handed over
    static_cast<XmlSax*>(self)->refuse();
}

void XmlSax::onElement(void* self, const xmlChar*, int, xmlElementContentPtr) {
    static_cast<XmlSax*>(self)->refuse();
}

void XmlSax::onNotation(void* self, const xmlChar*, const xmlChar*, const xmlChar*) {
    static_cast<XmlSax*>(self)->refuse();
}

void XmlSax::onUnparsed(void* self, const xmlChar*, const xmlChar*, const xmlChar*, const xmlChar*) {
    static_cast<XmlSax*>(self)->refuse();
}

} // namespace rolvane
