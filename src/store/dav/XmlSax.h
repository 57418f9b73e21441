#pragma once

#include <libxml/parser.h>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// A namespace-aware push parser over libxml2's SAX2 interface. A declaration within a document type, another encoding
// than UTF-8, UTF-16, ISO-8859-1 or ASCII, text that is not UTF-8 (RFC 3629) once it was decoded, a reference to an
// entity that XML does not define, depth over the limit or a false from a handler ends it. Base of the readers of
// WebDAV bodies; one thread.
class XmlSax {
public:
    explicit XmlSax(int maxDepth);
    virtual ~XmlSax();
    XmlSax(const XmlSax&) = delete;
    XmlSax& operator=(const XmlSax&) = delete;

    bool feed(std::string_view bytes);
    bool finish(); // true when the document was whole and well formed

protected:
    // Names are "local" for elements in "DAV:", "{uri}local" for others. `path` holds the open elements, this included.
    virtual bool opened(const std::vector<std::string>& path) = 0;
    virtual bool closed(const std::vector<std::string>& path) = 0;
    virtual bool text(std::string_view characters) = 0;

private:
    static void onStart(void* self, const xmlChar* local, const xmlChar* prefix, const xmlChar* uri, int,
                        const xmlChar**, int, int, const xmlChar**);
    static void onEnd(void* self, const xmlChar* local, const xmlChar* prefix, const xmlChar* uri);
    static void onText(void* self, const xmlChar* characters, int length);
    static void onReference(void* self, const xmlChar*);
    static void onEntity(void* self, const xmlChar*, int, const xmlChar*, const xmlChar*, xmlChar*);
    static void onAttribute(void* self, const xmlChar*, const xmlChar*, int, int, const xmlChar*, xmlEnumerationPtr);
    static void onElement(void* self, const xmlChar*, int, xmlElementContentPtr);
    static void onNotation(void* self, const xmlChar*, const xmlChar*, const xmlChar*);
    static void onUnparsed(void* self, const xmlChar*, const xmlChar*, const xmlChar*, const xmlChar*);
    void refuse();
    bool isText(std::string_view piece);

    xmlSAXHandler _handler{};
    xmlParserCtxtPtr _context = nullptr;
    std::vector<std::string> _path;
    std::string _begun; // the bytes of a character of which more has to come
    const size_t _maxDepth;
    bool _good = true;
};

} // namespace rolvane
