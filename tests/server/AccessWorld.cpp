#include "AccessWorld.h"

#include "foundation/Paths.h"

#include <sstream>

namespace rolvane {
namespace {

PrivateStoreOptions complete(const StoreDirectory& directory, PrivateStoreOptions options) {
    options.stateDirectory = directory.path("store");
    options.ownsProcess = true;
    options.tls = false;
    return options;
}

} // namespace

const std::string AccessWorld::kLock =
    "<D:lockinfo xmlns:D=\"DAV:\"><D:lockscope><D:exclusive/></D:lockscope><D:locktype><D:write/></D:locktype>"
    "</D:lockinfo>";
const std::string AccessWorld::kPatch = "<D:propertyupdate xmlns:D=\"DAV:\"><D:set><D:prop><x xmlns=\"urn:x\">1</x>"
                                        "</D:prop></D:set></D:propertyupdate>";

AccessWorld::AccessWorld(PrivateStoreOptions options) : store(complete(directory, std::move(options))) {
    for (const char* name : {"alice", "walter", "rita", "sam", "greta"}) store.addUser(name, rawPasswordOf(name));
    writeFileDurably(store.stateDirectory() + "/conf/groups", "# friends\nreaders: greta\nothers: sam walter\n");
    store.start();
}

RawAnswer AccessWorld::ask(const std::string& who, const std::string& method, const std::string& path,
                           std::vector<std::pair<std::string, std::string>> headers, const std::string& body) const {
    for (auto& [name, value] : headers)
        if (name == "Destination" && value.starts_with('/'))
            value.insert(0, "http://localhost:" + std::to_string(port()));
    return rawRequest(port(), {who, method, path, std::move(headers), body});
}

std::string AccessWorld::ace(const std::string& principal, const std::string& privileges, const std::string& more) {
    std::string text = "<D:ace><D:principal>" + principal + "</D:principal><D:grant>";
    std::istringstream names(privileges);
    for (std::string name; names >> name;) text += "<D:privilege><D:" + name + "/></D:privilege>";
    return text + "</D:grant>" + more + "</D:ace>";
}

std::string AccessWorld::lists() {
    return acl(ace(user("walter"), "read write") + ace(user("rita"), "read") + ace(group("readers"), "read"));
}

std::string AccessWorld::propfind(const std::string& names) {
    std::string text = "<D:propfind xmlns:D=\"DAV:\"><D:prop>";
    std::istringstream words(names);
    for (std::string name; words >> name;) text += "<D:" + name + "/>";
    return text + "</D:prop></D:propfind>";
}

void AccessWorld::reset() const {
    for (const char* who : {"alice", "sam"}) {
        const std::string home = std::string("/dav/") + who;
        ask(who, "DELETE", home + "/");
        ask(who, "MKCOL", home + "/");
        ask(who, "PUT", home + "/own", {}, std::string(who) + "'s own");
    }
    for (const char* name : {"walter", "rita", "greta"}) {
        ask(name, "DELETE", std::string("/dav/") + name + "/copy");
        ask(name, "PUT", std::string("/dav/") + name + "/own", {}, std::string(name) + "'s own");
    }
    const std::string tree = "/dav/alice/Contacts";
    ask("alice", "MKCOL", tree);
    ask("alice", "MKCOL", tree + "/People");
    ask("alice", "MKCOL", tree + "/People/7");
    ask("alice", "MKCOL", tree + "/locked");
    ask("alice", "PUT", tree + "/locked/file", {}, "locked");
    ask("alice", "PUT", tree + "/1:CXGroup", {}, "group");
    ask("alice", "PUT", tree + "/dateFile", {}, "why");
    ask("alice", "PUT", tree + "/People/7/1:CXPerson", {}, "person");
    ask("alice", "ACL", tree, {}, lists());
}

} // namespace rolvane
