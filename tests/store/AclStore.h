#pragma once

#include "RecordingTransport.h"
#include "store/dav/CXDAVManager.h"
#include "store/dav/CXDAVNode.h"
#include "support/TempHome.h"

#include <algorithm>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

namespace rolvane::test {

// A store with access lists, as RFC 3744 has it, in the place of a server: one list for alice's tree, principals below
// /principals/, and whatever a test makes it answer instead. Used by one thread.
class AclStore {
public:
    explicit AclStore(const std::string& user = "alice") : wire(std::make_shared<RecordingTransport>()), _user(user) {
        CXDAVAccount account;
        account.user = UserName(user);
        account.endpoint = "https://dav.example.org/dav/{user}/Contacts";
        wire->intercept([this](const HttpRequest& request) { return std::optional(answer(request)); });
        manager = std::make_unique<CXDAVManager>(account, wire);
        base = account.baseLocationFor(UserName("alice"));
    }

    static std::string response(const std::string& href, const std::string& properties, const char* status = "200 OK") {
        return "<D:response><D:href>" + href + "</D:href><D:propstat><D:prop>" + properties +
               "</D:prop><D:status>HTTP/1.1 " + status + "</D:status></D:propstat></D:response>\n";
    }
    static HttpResponse multistatus(const std::string& responses) {
        return answerOf(207, {{"content-type", "application/xml"}},
                        "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<D:multistatus xmlns:D=\"DAV:\">\n" + responses +
                            "</D:multistatus>\n");
    }
    static std::string ace(const std::string& href, const std::vector<std::string>& privileges,
                           const std::string& more = {}) {
        std::string out = "<D:ace><D:principal><D:href>" + href + "</D:href></D:principal><D:grant>";
        for (const auto& p : privileges) out += "<D:privilege><D:" + p + "/></D:privilege>";
        return out + "</D:grant>" + more + "</D:ace>";
    }

    HttpResponse answer(const HttpRequest& request) {
        bodies.push_back(request.body ? *request.body : std::string());
        if (instead)
            if (auto other = instead(request)) return *other;
        const std::string path = request.url.encodedPath();
        if (request.method == "OPTIONS") return answerOf(200, {{"dav", announces}});
        if (path.starts_with("/principals")) return withOrigin(principal(path, request));
        if (request.method == "ACL") return set(path, replaced(*request.body, "<D:href>" + origin + "/", "<D:href>/"));
        if (request.method == "PROPFIND" && bodies.back().find("<D:acl/>") != std::string::npos)
            return withOrigin(shown(path));
        return answerOf(404);
    }
    static std::string replaced(std::string text, const std::string& from, const std::string& to) {
        for (size_t at = 0; (at = text.find(from, at)) != std::string::npos; at += to.size())
            text.replace(at, from.size(), to);
        return text;
    }
    HttpResponse withOrigin(HttpResponse answer) const {
        answer.body = replaced(answer.body, "<D:href>/", "<D:href>" + origin + "/");
        return answer;
    }
    HttpResponse shown(const std::string& path) const {
        std::string list = protectedEntries;
        for (const auto& entry : entries) list += entry;
        if (!rootOfTheOneList.empty() && path != rootOfTheOneList) {
            const std::string end = "</D:ace>",
                              from = "<D:inherited><D:href>" + rootOfTheOneList + "</D:href></D:inherited>";
            for (size_t at = list.find(end); at != list.npos; at = list.find(end, at + from.size() + end.size()))
                list.insert(at, from);
        }
        std::string properties = "<D:acl>" + list + "</D:acl><D:owner><D:href>" +
                                 (path == rootOfTheOneList ? ownerOfTheRoot : "/principals/alice") +
                                 "</D:href></D:owner><D:principal-collection-set>";
        for (const auto& collection : collections) properties += "<D:href>" + collection + "</D:href>";
        return multistatus(response(path, properties + "</D:principal-collection-set>"));
    }
    HttpResponse principal(const std::string& path, const HttpRequest& request) const {
        if (!principalsAnswer) return answerOf(404);
        const auto shownAs = [](const std::string& href, const std::string& name) {
            return response(href, "<D:resourcetype><D:principal/></D:resourcetype><D:displayname>" + name +
                                      "</D:displayname>");
        };
        std::string depth;
        for (const auto& [name, value] : request.headers)
            if (name == "Depth") depth = value;
        if (path == "/principals/" || path == "/principals") {
            std::string all = response("/principals/", "<D:resourcetype><D:collection/></D:resourcetype>");
            for (const auto& [href, name] : people) all += shownAs(href, name);
            return multistatus(all);
        }
        const auto found = people.find(path);
        return found == people.end() ? answerOf(404) : multistatus(shownAs(path, found->second));
    }
    HttpResponse set(const std::string& path, const std::string& body) {
        if (!rootOfTheOneList.empty() && path != rootOfTheOneList)
            return answerOf(
                403, {}, "<?xml version=\"1.0\"?><D:error xmlns:D=\"DAV:\"><D:no-inherited-ace-conflict/></D:error>");
        if (setStatus != 200)
            return answerOf(setStatus, {}, "<?xml version=\"1.0\"?><D:error xmlns:D=\"DAV:\"><D:no-invert/></D:error>");
        const auto root = parseDAVTree(body);
        if (!root) return answerOf(400);
        entries.clear();
        for (const CXDAVNode* node : root->childAtIndex(0).childAtIndex(0).childNodesMatchingString("ace"))
            entries.push_back(node->xml());
        return answerOf(200);
    }
    // The lists as a fresh client of the owner's sees them, "r a b; w a".
    std::string lists() {
        AclStore other(_user);
        other.entries = entries;
        other.protectedEntries = protectedEntries;
        other.origin = origin;
        std::vector<std::string> readers, writers;
        if (!other.manager->ACLsAtURL(base, readers, writers)) return "unreadable";
        std::string out = "r";
        for (const auto& name : readers) out += " " + name;
        out += "; w";
        for (const auto& name : writers) out += " " + name;
        return out;
    }

    std::string announces = "1, 2, access-control";
    std::string protectedEntries = "<D:ace><D:principal><D:property><D:owner/></D:property></D:principal><D:grant>"
                                   "<D:privilege><D:all/></D:privilege></D:grant><D:protected/></D:ace>";
    std::vector<std::string> entries; // as XML
    std::string origin;               // before every path that the store writes
    std::vector<std::string> collections = {"/principals/"};
    std::map<std::string, std::string> people = {{"/principals/alice", "Alice"},
                                                 {"/principals/bob", "Bob"},
                                                 {"/principals/carl", "Carl"}}; // href to display name
    bool principalsAnswer = true;
    std::string rootOfTheOneList; // not empty: the only place that has a list; what lies below inherits it
    std::string ownerOfTheRoot = "/principals/alice";
    int setStatus = 200;
    RecordingTransport::Interceptor instead; // asked first
    std::vector<std::string> bodies;         // of every request

    TempHome home;
    std::shared_ptr<RecordingTransport> wire;
    std::unique_ptr<CXDAVManager> manager;
    Url base;

private:
    const std::string _user;
};

} // namespace rolvane::test
