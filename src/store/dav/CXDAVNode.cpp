#include "store/dav/CXDAVNode.h"

#include "store/dav/XmlSax.h"

namespace rolvane {
namespace {

constexpr std::string_view kWhiteSpace = " \t\r\n";

bool isWhiteSpace(std::string_view text) {
    return text.find_first_not_of(kWhiteSpace) == text.npos;
}

// Builds the tree from the inside out: an element becomes its parent's child when it closes.
struct TreeReader : XmlSax {
    explicit TreeReader(CXDAVNodeLimits l) : XmlSax(l.maxDepth), limits(l) {}

    const CXDAVNodeLimits limits;
    std::vector<std::vector<CXDAVNode>> open{1}; // the children so far of each open element, the document's first
    std::string gathered;
    size_t nodes = 0;

    bool opened(const std::vector<std::string>&) override {
        flush();
        open.emplace_back();
        return ++nodes <= limits.maxNodes;
    }
    bool text(std::string_view characters) override {
        gathered.append(characters);
        return true;
    }
    bool closed(const std::vector<std::string>& path) override {
        flush();
        CXDAVNode element = CXDAVNode::element(path.back(), std::move(open.back()));
        open.pop_back();
        open.back().push_back(std::move(element));
        return ++nodes <= limits.maxNodes;
    }
    void flush() {
        if (!isWhiteSpace(gathered)) open.back().push_back(CXDAVNode::text(gathered));
        gathered.clear();
    }
};

bool isSuccess(const CXDAVNode& propstat) {
    const CXDAVNode* status = propstat.firstChild("status");
    const std::string line = status ? status->content() : std::string();
    const size_t space = line.find(' ');
    return space != line.npos && std::string_view(line).substr(space + 1, 3) == "200";
}

} // namespace

CXDAVNode CXDAVNode::element(std::string name, std::vector<CXDAVNode> children) {
    CXDAVNode node;
    node._string = std::move(name);
    node._children = std::move(children);
    return node;
}

CXDAVNode CXDAVNode::text(std::string text) {
    CXDAVNode node;
    node._string = std::move(text);
    node._isText = true;
    return node;
}

std::vector<const CXDAVNode*> CXDAVNode::childNodesMatchingString(std::string_view name) const {
    std::vector<const CXDAVNode*> matching;
    for (const CXDAVNode& child : _children)
        if (!child._isText && child._string == name) matching.push_back(&child);
    return matching;
}

const CXDAVNode* CXDAVNode::firstChild(std::string_view name) const {
    for (const CXDAVNode& child : _children)
        if (!child._isText && child._string == name) return &child;
    return nullptr;
}

std::string CXDAVNode::content() const {
    std::string all;
    for (const CXDAVNode& child : _children)
        if (child._isText) all += child._string;
    const size_t first = all.find_first_not_of(kWhiteSpace);
    return first == all.npos ? std::string() : all.substr(first, all.find_last_not_of(kWhiteSpace) - first + 1);
}

std::string CXDAVNode::escaped(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (const char c : text) {
        if (c == '&')
            out += "&amp;";
        else if (c == '<')
            out += "&lt;";
        else if (c == '>')
            out += "&gt;";
        else if (c == '"')
            out += "&quot;";
        else
            out += c;
    }
    return out;
}

void CXDAVNode::write(std::string& out) const {
    if (_isText) {
        out += escaped(_string);
        return;
    }
    std::string name = "D:" + _string, space = "DAV:";
    if (_string.starts_with('{')) {
        const size_t end = _string.rfind('}');
        space = _string.substr(1, end - 1);
        // A name in no namespace has no prefix.
        name = (space.empty() ? "" : "x:") + _string.substr(end + 1);
    }
    out += "<" + name;
    if (!space.empty()) out += std::string(" xmlns:") + name[0] + "=\"" + escaped(space) + "\"";
    if (_children.empty()) {
        out += "/>";
        return;
    }
    out += ">";
    for (const CXDAVNode& child : _children) child.write(out);
    out += "</" + name + ">";
}

std::string CXDAVNode::xml() const {
    std::string out;
    write(out);
    return out;
}

std::optional<CXDAVNode> parseDAVTree(std::string_view text, CXDAVNodeLimits limits) {
    TreeReader reader(limits);
    if (!reader.feed(text) || !reader.finish() || reader.open.size() != 1 || reader.open.front().size() != 1)
        return std::nullopt;
    std::vector<CXDAVNode> document;
    document.push_back(CXDAVNode::element("", std::move(reader.open.front())));
    return CXDAVNode::element("", std::move(document));
}

const CXDAVNode* davProperty(const CXDAVNode& response, std::string_view name) {
    for (const CXDAVNode* propstat : response.childNodesMatchingString("propstat"))
        if (isSuccess(*propstat))
            for (const CXDAVNode* prop : propstat->childNodesMatchingString("prop"))
                if (const CXDAVNode* found = prop->firstChild(name)) return found;
    return nullptr;
}

std::optional<std::vector<const CXDAVNode*>> davResponses(const CXDAVNode& root) {
    if (root.childCount() != 1 || root.childAtIndex(0).childCount() != 1) return std::nullopt;
    const CXDAVNode* multistatus = root.childAtIndex(0).firstChild("multistatus");
    if (!multistatus) return std::nullopt;
    return multistatus->childNodesMatchingString("response");
}

} // namespace rolvane
