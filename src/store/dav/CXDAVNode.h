#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// A node of an answer's XML: an element with its children, or a piece of text. A plain value.
class CXDAVNode {
public:
    static CXDAVNode element(std::string name, std::vector<CXDAVNode> children = {});
    static CXDAVNode text(std::string text);

    // An element's name or the text. Names are "local" for elements in "DAV:", "{uri}local" for others and "" for the
    // two nodes that stand above the document's own element.
    const std::string& string() const { return _string; }
    bool isText() const { return _isText; }
    size_t childCount() const { return _children.size(); }
    const CXDAVNode& childAtIndex(size_t i) const { return _children.at(i); }
    const std::vector<CXDAVNode>& children() const { return _children; }
    std::vector<const CXDAVNode*> childNodesMatchingString(std::string_view name) const; // elements only; borrowed
    const CXDAVNode* firstChild(std::string_view name) const;                            // the first of them, or none
    std::string content() const; // the texts directly inside, joined

    // The element as text that can stand in any document: every name carries its own namespace.
    std::string xml() const;
    static std::string escaped(std::string_view text);

private:
    void write(std::string& out) const;

    std::string _string;
    bool _isText = false;
    std::vector<CXDAVNode> _children;
};

struct CXDAVNodeLimits {
    int maxDepth = 32;
    size_t maxNodes = 500000;
};

// The document as a tree: a root with one child, which has the document's own element as its one child. White space
// between elements is dropped. Nothing when the text is not one whole, well-formed document without a document type, or
// passes a limit. Attributes are not kept.
std::optional<CXDAVNode> parseDAVTree(std::string_view text, CXDAVNodeLimits limits = {});

// The properties of one `response` of a multistatus that came with status 200 (RFC 4918 section 14.22). Borrowed.
const CXDAVNode* davProperty(const CXDAVNode& response, std::string_view name);
// The `response` elements of a parsed multistatus; nothing when it is none. Borrowed.
std::optional<std::vector<const CXDAVNode*>> davResponses(const CXDAVNode& root);

} // namespace rolvane
