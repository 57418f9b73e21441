#include "AccessWorld.h"

#include "foundation/Paths.h"
#include "server/StoreConfiguration.h"

#include <fstream>
#include <gtest/gtest.h>

#include <cstdlib>
#include <sstream>
#include <stdexcept>

namespace rolvane {
namespace {

constexpr const char* kUsers[] = {"alice", "walter", "rita", "sam", "greta"};

void replaceAll(std::string& text, const std::string& from, const std::string& to) {
    for (size_t at = 0; (at = text.find(from, at)) != std::string::npos; at += to.size())
        text.replace(at, from.size(), to);
}

// The store's own configuration, with another provider in the place of the text file.
std::string withDbm(std::string text) {
    replaceAll(text, "mod_authn_file.so", "mod_authn_dbm.so");
    replaceAll(text, "authn_file_module", "authn_dbm_module");
    replaceAll(text, "AuthBasicProvider davacl",
               "AuthBasicProvider dbm\nAuthDBMType SDBM\nAuthDBMUserFile \"@STATE@/conf/users\"");
    replaceAll(text, "DavAclUserFile \"@STATE@/conf/passwords\"", "DavAclUsers dbm");
    return text;
}

PrivateStoreOptions complete(AccessVariant variant, const StoreDirectory& directory, PrivateStoreOptions options) {
    options.stateDirectory = directory.path("store");
    options.ownsProcess = true;
    options.tls = false;
    if (variant == AccessVariant::digest) options.authentication = StoreAuthentication::digest;
    if (variant == AccessVariant::dbm) {
        options.configurationTemplate = directory.path("httpd.conf.in");
        writeFileDurably(options.configurationTemplate, withDbm(readFile(storeTemplatePath())));
    }
    if (variant == AccessVariant::sanitized) {
        options.accessModule = ROLVANE_SANITIZED_DAVACL;
        // httpd was itself built without sanitizers, so it loads them before everything else; leaks are its own.
        options.environment = {std::string("LD_PRELOAD=") + ROLVANE_SANITIZERS, "ASAN_OPTIONS=detect_leaks=0",
                               "UBSAN_OPTIONS=print_stacktrace=1"};
    }
    return options;
}

} // namespace

const std::string AccessWorld::kLock =
    "<D:lockinfo xmlns:D=\"DAV:\"><D:lockscope><D:exclusive/></D:lockscope><D:locktype><D:write/></D:locktype>"
    "</D:lockinfo>";
const std::string AccessWorld::kPatch = "<D:propertyupdate xmlns:D=\"DAV:\"><D:set><D:prop><x xmlns=\"urn:x\">1</x>"
                                        "</D:prop></D:set></D:propertyupdate>";

AccessWorld::AccessWorld(AccessVariant theVariant, PrivateStoreOptions options)
    : variant(theVariant), store(complete(variant, directory, std::move(options))) {
    makeUsers();
    writeFileDurably(store.stateDirectory() + "/conf/groups", "# friends\nreaders: greta\nothers: sam walter\n");
    store.start();
}

AccessWorld::~AccessWorld() {
    if (variant != AccessVariant::sanitized) return;
    store.stop();
    for (const char* name : {"/logs/error.log", "/startup.log"}) { // after a long run they are large
        std::ifstream lines(store.stateDirectory() + name);
        for (std::string line; std::getline(lines, line);)
            for (const char* word : {"Sanitizer", "runtime error"})
                EXPECT_EQ(line.find(word), std::string::npos) << name << ": " << line;
    }
}

void AccessWorld::makeUsers() {
    for (const char* name : kUsers) store.addUser(name, rawPasswordOf(name));
    if (variant != AccessVariant::dbm) return;
    const std::string file = store.stateDirectory() + "/conf/users";
    for (const char* name : kUsers) {
        const char* how = name == kUsers[0] ? "-cbm" : "-bm";
        const CommandResult made = runCommand({"htdbm", how, "-TSDBM", file, name, rawPasswordOf(name)});
        if (made.status != 0) throw std::runtime_error("htdbm: " + made.errors);
    }
    writeFileDurably(store.stateDirectory() + "/conf/passwords", "", 0600); // nobody is known by it
}

RawAnswer AccessWorld::ask(const std::string& who, const std::string& method, const std::string& path,
                           std::vector<std::pair<std::string, std::string>> headers, const std::string& body) const {
    for (auto& [name, value] : headers)
        if (name == "Destination" && value.starts_with('/'))
            value.insert(0, "http://localhost:" + std::to_string(port()));
    if (variant != AccessVariant::digest || who.empty())
        return rawRequest(port(), {who, method, path, std::move(headers), body});
    RawRequest request{"", method, path, std::move(headers), body};
    if (_nonce.empty()) _nonce = nonceIn(rawRequest(port(), {"", "GET", "/principals/"}));
    request.headers.emplace_back("Authorization", rawDigest(who, request, _nonce));
    return rawRequest(port(), request);
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
