#include "store/dav/Multistatus.h"

#include "foundation/TestSwitch.h"
#include "store/dav/XmlSax.h"

#include <algorithm>
#include <charconv>
#include <initializer_list>
#include <utility>

namespace rolvane {

namespace {

constexpr std::string_view kMembersTag = "{http://rolvane.net/ns/}members-tag";

std::string trimmed(const std::string& text) {
    const size_t first = text.find_first_not_of(" \t\r\n");
    if (first == std::string::npos) return {};
    return text.substr(first, text.find_last_not_of(" \t\r\n") - first + 1);
}

std::optional<uint64_t> parsedNumber(std::string_view text) {
    uint64_t n = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), n);
    if (error != std::errc() || end != text.data() + text.size()) return std::nullopt;
    return n;
}

// As the standard has it, or as some servers write it.
std::optional<Date> parsedDate(const std::string& text) {
    const auto date = Date::fromHTTP(text);
    return date ? date : Date::fromISO8601(text);
}

// "HTTP/1.1 200 OK" -> 200
int parsedStatus(const std::string& line) {
    const size_t space = line.find(' ');
    if (space == std::string::npos) return -1;
    const auto n = parsedNumber(std::string_view(line).substr(space + 1, 3));
    return n ? static_cast<int>(*n) : -1;
}

} // namespace

struct MultistatusReader::Impl : XmlSax {
    explicit Impl(MultistatusLimits l) : XmlSax(l.maxDepth), limits(l) {}

    const MultistatusLimits limits;
    std::vector<MultistatusEntry> entries;
    MultistatusEntry entry;   // the response under way
    MultistatusEntry offered; // what the propstat under way offers
    int propstatStatus = 0;
    bool rootSeen = false, hrefSeen = false;
    bool statusSeen = false; // of the propstat under way
    std::string gathered, syncToken;

    bool opened(const std::vector<std::string>& path) override {
        gathered.clear();
        if (path.size() == 1) return rootSeen = path[0] == "multistatus";
        if (path.size() == 2 && path[1] == "response") {
            entry = {};
            hrefSeen = false;
        } else if (path.size() == 3 && path[2] == "propstat") {
            offered = {};
            propstatStatus = 0;
            statusSeen = false;
        } else if (path.size() == 6 && path[4] == "resourcetype" && path[5] == "collection") {
            offered.isCollection = true;
        }
        return true;
    }

    bool text(std::string_view characters) override {
        gathered.append(characters);
        return gathered.size() <= limits.maxText;
    }

    bool closed(const std::vector<std::string>& path) override {
        const std::string content = trimmed(gathered);
        gathered.clear();
        if (path.size() == 2 && path[1] == "sync-token") syncToken = content;
        if (path.size() < 2 || path[1] != "response") return true;
        if (path.size() == 2) return closedResponse();
        if (path.size() == 3) return closedInResponse(path[2], content);
        if (path[2] != "propstat") return true;
        if (path.size() == 4 && path[3] == "status") {
            propstatStatus = parsedStatus(content);
            statusSeen = true;
        }
        if (path.size() == 5 && path[3] == "prop") closedProperty(path[4], content);
        return true;
    }

    bool closedResponse() {
        if (!hrefSeen || entries.size() >= limits.maxEntries) return false;
        entries.push_back(std::move(entry));
        return true;
    }

    bool closedInResponse(const std::string& name, const std::string& content) {
        if (name == "href" && !hrefSeen) {
            entry.href = content;
            hrefSeen = true;
        } else if (name == "status") {
            entry.status = parsedStatus(content);
        } else if (name == "propstat" && (propstatStatus == 200 || !statusSeen)) {
            takeOffered();
        }
        return true;
    }

    void closedProperty(const std::string& name, const std::string& content) {
        if (name == "getlastmodified") offered.lastModified = parsedDate(content);
        if (name == "getcontentlength") offered.length = parsedNumber(content);
        if (name == "getetag") offered.etag = EntityTag(content);
        if (name == kMembersTag) offered.membersTag = content;
        if (name == "sync-token") offered.syncToken = content;
    }

    void takeOffered() {
        entry.isCollection = entry.isCollection || offered.isCollection;
        if (offered.lastModified) entry.lastModified = offered.lastModified;
        if (offered.length) entry.length = offered.length;
        if (!offered.etag.empty()) entry.etag = offered.etag;
        if (!offered.membersTag.empty()) entry.membersTag = offered.membersTag;
        if (!offered.syncToken.empty()) entry.syncToken = offered.syncToken;
    }
};

MultistatusReader::MultistatusReader(MultistatusLimits limits) : _impl(std::make_unique<Impl>(limits)) {}
MultistatusReader::~MultistatusReader() = default;

bool MultistatusReader::feed(std::string_view bytes) {
    return _impl->feed(bytes);
}

std::optional<std::vector<MultistatusEntry>> MultistatusReader::finish() {
    const bool isWhole = _impl->finish() || isLeftOut("end of listing");
    if (!isWhole || !_impl->rootSeen) return std::nullopt;
    return std::move(_impl->entries);
}

const std::string& MultistatusReader::syncToken() const {
    return _impl->syncToken;
}

namespace {

struct LockAnswerReader : XmlSax {
    LockAnswerReader() : XmlSax(32) {}
    std::vector<LockGrant> grants;
    LockGrant grant; // the one that is being read
    std::string gathered;

    bool opened(const std::vector<std::string>&) override {
        gathered.clear();
        return true;
    }
    bool text(std::string_view characters) override {
        gathered.append(characters);
        return gathered.size() <= 16384;
    }
    bool closed(const std::vector<std::string>& path) override {
        const std::string content = trimmed(gathered);
        gathered.clear();
        if (endsWith(path, {"activelock", "timeout"}) && content.starts_with("Second-")) {
            if (const auto n = parsedNumber(std::string_view(content).substr(7)))
                grant.timeoutSeconds = static_cast<double>(*n);
        }
        if (endsWith(path, {"activelock", "owner"})) grant.owner = content;
        if (endsWith(path, {"activelock", "locktoken", "href"})) grant.token = LockToken(content);
        if (!path.empty() && path.back() == "activelock") grants.push_back(std::exchange(grant, {}));
        return true;
    }
    static bool endsWith(const std::vector<std::string>& path, std::initializer_list<std::string_view> end) {
        return path.size() > end.size() &&
               std::equal(end.begin(), end.end(), path.end() - static_cast<std::ptrdiff_t>(end.size()));
    }
};

} // namespace

std::optional<std::vector<LockGrant>> parseLockDiscovery(std::string_view body) {
    LockAnswerReader reader;
    if (body.size() > (1u << 20) || !reader.feed(body) || !reader.finish()) return std::nullopt;
    return std::move(reader.grants);
}

std::optional<LockGrant> parseLockAnswer(std::string_view body) {
    const auto grants = parseLockDiscovery(body);
    return grants && !grants->empty() ? std::optional(grants->back()) : std::nullopt;
}

} // namespace rolvane
