#include "OddServer.h"

#include "foundation/Url.h"

#include <algorithm>
#include <cstdint>

namespace rolvane::test {

namespace {

constexpr const char* kDate = "Sat, 21 Nov 2026 10:00:00 GMT";

std::string parentOf(const std::string& path) {
    return path.substr(0, path.rfind('/'));
}

std::string encoded(const std::string& path) {
    std::string out;
    for (size_t at = 0; at < path.size();) {
        const size_t end = std::min(path.find('/', at + 1), path.size());
        out += "/" + Url::percentEncodeComponent(path.substr(at + 1, end - at - 1));
        at = end;
    }
    return out;
}

// A gzip file of stored blocks (RFC 1951 section 3.2.4, RFC 1952).
std::string gzipped(const std::string& text) {
    uint32_t crc = 0xffffffffu;
    for (const char c : text) {
        crc ^= static_cast<unsigned char>(c);
        for (int bit = 0; bit < 8; ++bit) crc = (crc >> 1) ^ ((crc & 1) != 0 ? 0xedb88320u : 0u);
    }
    std::string out("\x1f\x8b\x08\0\0\0\0\0\0\x03", 10);
    const auto number = [&out](uint32_t n, int bytes) {
        for (int i = 0; i < bytes; ++i) out += static_cast<char>(n >> (8 * i) & 0xff);
    };
    for (size_t at = 0; at == 0 || at < text.size(); at += 65535) {
        const std::string block = text.substr(at, 65535);
        out += static_cast<char>(at + block.size() >= text.size() ? 1 : 0);
        number(static_cast<uint32_t>(block.size()), 2);
        number(~static_cast<uint32_t>(block.size()), 2);
        out += block;
    }
    number(~crc, 4);
    number(static_cast<uint32_t>(text.size()), 4);
    return out;
}

std::string headerOf(const FakeRequest& request, const std::string& name) {
    const auto found = request.headers.find(name);
    return found == request.headers.end() ? "" : found->second;
}

} // namespace

OddServer::OddServer(Oddities oddities)
    : _odd(std::move(oddities)), _http([this](const FakeRequest& request) { return answer(request); }) {}

size_t OddServer::count(const std::string& method) const {
    size_t n = 0;
    for (const FakeRequest& r : requests()) n += r.method == method;
    return n;
}

void OddServer::be(Oddities oddities) {
    const std::lock_guard guard(_mutex);
    _odd = std::move(oddities);
}

Oddities OddServer::habits() const {
    const std::lock_guard guard(_mutex);
    return _odd;
}

std::map<std::string, std::string> OddServer::files() const {
    const std::lock_guard guard(_mutex);
    std::map<std::string, std::string> out;
    for (const auto& [path, file] : _files) out[path] = file.text;
    return out;
}

std::set<std::string> OddServer::collections() const {
    const std::lock_guard guard(_mutex);
    return _collections;
}

std::set<std::string> OddServer::locked() const {
    const std::lock_guard guard(_mutex);
    std::set<std::string> out;
    for (const auto& [path, token] : _locks) out.insert(path);
    return out;
}

void OddServer::write(const std::string& path, const std::string& text) {
    const std::lock_guard guard(_mutex);
    _files[path] = {text, ++_last};
}

void OddServer::makeCollection(const std::string& path) {
    const std::lock_guard guard(_mutex);
    _collections.insert(path);
}

std::string OddServer::tagOf(const File& file) const {
    return (_odd.weakTags ? "W/\"v" : "\"v") + std::to_string(file.version) + "\"";
}

FakeAnswer OddServer::said(int status, const std::string& body, const std::string& headers) const {
    std::string head = headers;
    if (_odd.dateHeader) head += std::string("Date: ") + kDate + "\r\n";
    const bool encodes = !_odd.encoding.empty() && !body.empty();
    if (encodes) head += "Content-Encoding: " + _odd.encoding + "\r\n";
    return FakeAnswer::status(status, encodes && _odd.encoding == "gzip" ? gzipped(body) : body, head);
}

FakeAnswer OddServer::answer(const FakeRequest& request) {
    const std::lock_guard guard(_mutex);
    std::string path = Url::percentDecode(request.target);
    const bool slash = path.ends_with('/');
    if (slash) path.pop_back();
    if (_odd.redirectsToSlash && _collections.contains(path) && !slash)
        return said(301, "", "Location: " + request.target + "/\r\n");
    return answerTo(request, path, slash);
}

FakeAnswer OddServer::answerTo(const FakeRequest& request, const std::string& path, bool slash) {
    const std::string& method = request.method;
    if (method == "OPTIONS") {
        if (exists(path) || _odd.optionsOfMissing == 200) return said(200, "", _odd.davHeaders);
        FakeAnswer none;
        none.silent = true;
        return _odd.optionsOfMissing == 0 ? none : said(_odd.optionsOfMissing);
    }
    if (method == "PROPFIND") return exists(path) ? listing(request, path) : said(404);
    if (method == "MKCOL") {
        if (_odd.mkcol != 0) return said(_odd.mkcol);
        if (exists(path)) return said(_odd.makesAgain ? 201 : 405);
        if (!_collections.contains(parentOf(path)) || (_odd.wantsSlash && !slash)) return said(409);
        _collections.insert(path);
        return said(201);
    }
    if (method == "PUT") return _odd.put != 0 ? said(_odd.put) : put(request, path);
    if (method == "LOCK") return lock(request, path);
    if (method == "COPY" || method == "MOVE") return transfer(request, path);
    if (!exists(path)) return said(404);
    if (method == "GET" || method == "HEAD") {
        if (_collections.contains(path)) return said(403);
        const File& file = _files[path];
        std::string headers = "Content-Type: application/xml\r\n";
        if (_odd.dates) headers += std::string("Last-Modified: ") + kDate + "\r\n";
        if (_odd.tags) headers += "ETag: " + tagOf(file) + "\r\n";
        return said(200, method == "GET" ? file.text : "", headers);
    }
    if (method == "DELETE") {
        if (_odd.wantsSlash && !slash && _collections.contains(path)) return said(409);
        removeBelow(path);
        const std::string all = "<D:multistatus xmlns:D=\"DAV:\"><D:response><D:href>" + encoded(path) +
                                "</D:href><D:status>HTTP/1.1 200 OK</D:status></D:response></D:multistatus>";
        return _odd.deleted == 207 ? said(207, all, "Content-Type: application/xml\r\n") : said(_odd.deleted);
    }
    if (method == "UNLOCK") {
        const auto found = _locks.find(path);
        if (found == _locks.end() || headerOf(request, "lock-token") != "<" + found->second + ">") return said(409);
        _locks.erase(found);
        return said(204);
    }
    return said(501);
}

FakeAnswer OddServer::put(const FakeRequest& request, const std::string& path) {
    if (!_collections.contains(parentOf(path))) return said(409);
    if (_collections.contains(path)) return said(405);
    const auto found = _files.find(path);
    const bool isThere = found != _files.end();
    const std::string none = headerOf(request, "if-none-match"), match = headerOf(request, "if-match");
    const std::string condition = headerOf(request, "if");
    if (!none.empty() && _odd.ifNoneMatch != 0) return said(_odd.ifNoneMatch);
    if (condition.find('[') != std::string::npos) {
        if (_odd.ifWithTag != 0) return said(_odd.ifWithTag);
        if (!isThere || condition.find("[" + tagOf(found->second) + "]") == std::string::npos) return said(412);
    }
    if (!none.empty() && isThere) return said(412);
    if (!match.empty() && (!isThere || match != tagOf(found->second))) return said(412);
    if (const auto lock = _locks.find(path); lock != _locks.end() && condition.find(lock->second) == std::string::npos)
        return said(423);
    File& file = _files[path];
    file = {request.body, ++_last};
    return said(isThere ? 204 : 201, "", _odd.tags ? "ETag: " + tagOf(file) + "\r\n" : "");
}

std::string OddServer::entry(const std::string& path) const {
    const bool isCollection = _collections.contains(path);
    std::string out = "<D:response><D:href>" + _odd.hrefOrigin + encoded(path) + (isCollection ? "/" : "") +
                      "</D:href><D:propstat><D:prop><D:resourcetype>" + (isCollection ? "<D:collection/>" : "") +
                      "</D:resourcetype>";
    if (_odd.dates)
        out += std::string("<D:getlastmodified>") + (_odd.isoDates ? "2026-11-21T10:00:00Z" : kDate) +
               "</D:getlastmodified>";
    if (!isCollection) {
        const File& file = _files.at(path);
        out += "<D:getcontentlength>" + std::to_string(file.text.size()) + "</D:getcontentlength>";
        if (_odd.tags) out += "<D:getetag>" + tagOf(file) + "</D:getetag>";
    }
    if (const auto lock = _locks.find(path); lock != _locks.end() && _odd.tellsLocks)
        out += "<D:lockdiscovery><D:activelock><D:locktoken><D:href>" + lock->second +
               "</D:href></D:locktoken></D:activelock></D:lockdiscovery>";
    return out + "</D:prop>" + (_odd.statuses ? "<D:status>HTTP/1.1 200 OK</D:status>" : "") +
           "</D:propstat></D:response>";
}

FakeAnswer OddServer::listing(const FakeRequest& request, const std::string& path) {
    const bool deep = headerOf(request, "depth") != "0" && _collections.contains(path);
    std::string body = "<?xml version=\"1.0\"?>" + _odd.doctype + "<D:multistatus xmlns:D=\"DAV:\">";
    if (!deep || _odd.namesItself) body += entry(path);
    if (deep) {
        for (const auto& [file, content] : _files)
            if (parentOf(file) == path) body += entry(file);
        for (const std::string& collection : _collections)
            if (collection != path && !collection.empty() && parentOf(collection) == path) body += entry(collection);
    }
    return said(_odd.multistatus, body + "</D:multistatus>", "Content-Type: application/xml\r\n");
}

FakeAnswer OddServer::lock(const FakeRequest& request, const std::string& path) {
    if (!exists(path)) return said(404);
    const bool isRefresh = request.body.empty();
    if (_locks.contains(path) != isRefresh) return said(isRefresh ? 412 : 423);
    if (!isRefresh) _locks[path] = "urn:uuid:odd-" + std::to_string(++_last);
    const std::string token = _locks[path];
    return said(_odd.lockGranted,
                "<D:prop xmlns:D=\"DAV:\"><D:lockdiscovery><D:activelock><D:timeout>Second-300</D:timeout><D:locktoken>"
                "<D:href>" +
                    token + "</D:href></D:locktoken></D:activelock></D:lockdiscovery></D:prop>",
                "Content-Type: application/xml\r\nLock-Token: <" + token + ">\r\n");
}

FakeAnswer OddServer::transfer(const FakeRequest& request, const std::string& path) {
    const std::string destination = headerOf(request, "destination");
    std::string to = Url::percentDecode(destination.substr(std::min(destination.size(), origin().size())));
    if (to.ends_with('/')) to.pop_back();
    if (!exists(path)) return said(404);
    if (headerOf(request, "if").find('[') != std::string::npos && _odd.ifWithTag != 0) return said(_odd.ifWithTag);
    // As nginx: both names end with a slash, or neither does.
    if (_odd.wantsSlash && _collections.contains(path) && !destination.ends_with('/')) return said(409);
    const bool replaces = exists(to);
    removeBelow(to);
    const auto moved = [&](const std::string& one) { return to + one.substr(path.size()); };
    const auto isBelow = [&](const std::string& one) { return one == path || one.starts_with(path + "/"); };
    const auto files = _files;
    const auto collections = _collections;
    for (const auto& [file, content] : files)
        if (isBelow(file)) _files[moved(file)] = content;
    for (const std::string& collection : collections)
        if (isBelow(collection)) _collections.insert(moved(collection));
    if (request.method == "MOVE") removeBelow(path);
    return said(replaces ? 204 : 201);
}

void OddServer::removeBelow(const std::string& path) {
    const auto isBelow = [&](const std::string& one) { return one == path || one.starts_with(path + "/"); };
    std::erase_if(_files, [&](const auto& file) { return isBelow(file.first); });
    std::erase_if(_collections, [&](const std::string& collection) { return isBelow(collection); });
    std::erase_if(_locks, [&](const auto& lock) { return isBelow(lock.first); });
}

} // namespace rolvane::test
