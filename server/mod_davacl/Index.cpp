#include "server/mod_davacl/Index.h"

#include "foundation/Utf8.h"
#include "server/mod_davacl/Access.h"

#include <apr_file_info.h>
#include <apr_time.h>
#include <cstring>
#include <iterator>
#include <optional>
#include <set>
#include <string>
#include <string_view>

namespace rolvane::davacl {
namespace {

constexpr size_t kMostShown = 10000; // members: a page of some two megabytes

struct Members {
    std::set<std::string> names; // the first by name
    size_t besides = 0;          // readable, too, and not shown
};

std::string quoted(request_rec* r, const std::string& text) {
    return apr_xml_quote_string(r->pool, text.c_str(), 1);
}

// A text as a page may show it: bytes that are no text, and control characters, become U+FFFD.
std::string shown(request_rec* r, std::string_view name) {
    std::string text;
    while (!name.empty()) {
        const auto next = takeCodePoint(name);
        if (!next) name.remove_prefix(1);
        const bool isControl = next && (*next < 0x20 || (*next >= 0x7f && *next < 0xa0));
        appendUtf8(next && !isControl ? *next : U'\ufffd', text);
    }
    return quoted(r, text);
}

// A name of another direction leaves the rest of its line alone.
std::string apart(const std::string& name) {
    return "<bdi>" + name + "</bdi>";
}

bool isSlashed(const request_rec* r) {
    return r->uri[0] && r->uri[std::strlen(r->uri) - 1] == '/';
}

// From the page to a member, or to the collection above. Relative, so that it leads there also behind a proxy that has
// another path for the store; "./" comes first, since a name may look like a scheme.
std::string hrefTo(request_rec* r, const TreePath& place, const std::string& member) {
    const std::string own = place.below.empty() ? place.owner : place.below.back();
    const std::string to = (isSlashed(r) ? "./" : "./" + own + "/") + member;
    return quoted(r, ap_os_escape_path(r->pool, to.c_str(), 1));
}

const char* hrefAbove(const request_rec* r) {
    return isSlashed(r) ? "../" : "./";
}

bool isReadable(request_rec* r, const Configuration& c, const TreePath& place, const std::string& name) {
    TreePath member = place;
    if (place.isBase())
        member.owner = name;
    else
        member.below.push_back(name);
    return !member.isReserved() && (privilegesOn(r, c, member) & kRead);
}

// Nothing when the directory cannot be read.
std::optional<Members> readMembers(request_rec* r, const Configuration& c, const TreePath& place) {
    apr_dir_t* directory = nullptr;
    if (apr_dir_open(&directory, r->filename, r->pool) != APR_SUCCESS) return std::nullopt;
    Members found;
    apr_finfo_t entry;
    while (apr_dir_read(&entry, APR_FINFO_NAME, directory) == APR_SUCCESS) {
        const std::string name = entry.name;
        if (name == "." || name == ".." || !isReadable(r, c, place, name)) continue;
        found.names.insert(name);
        if (found.names.size() <= kMostShown) continue;
        found.names.erase(std::prev(found.names.end()));
        ++found.besides;
    }
    apr_dir_close(directory);
    return found;
}

// A row of the table. Nothing for what is neither file nor collection, a symbolic link for instance.
std::string rowFor(request_rec* r, const TreePath& place, const std::string& name, apr_pool_t* pool) {
    apr_finfo_t info;
    const std::string path =
        std::string(r->filename) + (r->filename[std::strlen(r->filename) - 1] == '/' ? "" : "/") + name;
    constexpr apr_int32_t kWanted = APR_FINFO_TYPE | APR_FINFO_SIZE | APR_FINFO_MTIME | APR_FINFO_LINK;
    const apr_status_t status = apr_stat(&info, path.c_str(), kWanted, pool);
    if ((status != APR_SUCCESS && status != APR_INCOMPLETE) || (info.filetype != APR_DIR && info.filetype != APR_REG))
        return {};
    apr_time_exp_t date;
    apr_size_t length = 0;
    char text[32] = {};
    apr_time_exp_gmt(&date, info.mtime);
    apr_strftime(text, &length, sizeof text, "%Y-%m-%d %H:%M:%S", &date);
    const bool isCollection = info.filetype == APR_DIR;
    return "<tr><td><a href=\"" + hrefTo(r, place, name + (isCollection ? "/" : "")) + "\">" + apart(shown(r, name)) +
           (isCollection ? "/" : "") + "</a></td><td align=\"right\">" +
           (isCollection ? std::string() : std::to_string(info.size)) + "</td><td>" + text + "</td></tr>\n";
}

std::string titleOf(const TreePath& place) {
    if (place.isBase()) return "Published trees";
    std::string title = "The published tree of " + place.owner;
    for (const std::string& name : place.below) title += " / " + name;
    return title;
}

std::string pageFor(request_rec* r, const TreePath& place, const Members& members) {
    const std::string title = shown(r, titleOf(place));
    std::string text = "<!DOCTYPE html>\n<html lang=\"en\"><head><meta charset=\"utf-8\"><title>" + title +
                       "</title></head>\n<body><h1>" + apart(title) + "</h1>\n";
    if (!place.isBase()) text += std::string("<p><a href=\"") + hrefAbove(r) + "\">One level up</a></p>\n";
    text += "<table>\n<tr><th align=\"left\">Name</th><th align=\"right\">Bytes</th><th align=\"left\">Changed "
            "(UTC)</th></tr>\n";
    apr_pool_t* pool = nullptr; // of one row: there may be many
    apr_pool_create(&pool, r->pool);
    for (const std::string& name : members.names) {
        text += rowFor(r, place, name, pool);
        apr_pool_clear(pool);
    }
    apr_pool_destroy(pool);
    text += "</table>\n";
    if (members.names.empty()) text += "<p>Nothing is here that you may read.</p>\n";
    if (members.besides)
        text += "<p>Not shown are " + std::to_string(members.besides) + " more. WebDAV lists them all.</p>\n";
    return text + "</body></html>\n";
}

int serve(request_rec* r) {
    const Configuration* c = configurationOf(r);
    if (!c || r->method_number != M_GET || standingOf(r) != Standing::collection) return DECLINED; // GET is HEAD, too
    const auto place = TreePath::of(c->base, r->uri);
    if (!place) return DECLINED;
    const auto members = readMembers(r, *c, *place);
    if (!members) return HTTP_FORBIDDEN;
    const std::string page = pageFor(r, *place, *members);
    ap_set_content_type(r, "text/html; charset=utf-8");
    ap_set_content_length(r, static_cast<apr_off_t>(page.size()));
    if (!r->header_only) ap_rwrite(page.data(), static_cast<int>(page.size()), r);
    return OK;
}

} // namespace

int serveIndex(request_rec* r) noexcept {
    return contained(r, static_cast<int>(HTTP_INTERNAL_SERVER_ERROR), [r] { return serve(r); });
}

} // namespace rolvane::davacl
