#pragma once

#include "RecordingTransport.h"
#include "foundation/PropertyList.h"
#include "server/PrivateStore.h"
#include "store/dav/CXDAVManager.h"
#include "support/TempHome.h"

#include <filesystem>
#include <fstream>
#include <iterator>
#include <memory>
#include <string>

namespace rolvane::test {

// A home of its own, a private store on a real httpd with the users alice and bob, and clients of it.
struct StoreWorld {
    explicit StoreWorld(PrivateStoreOptions options = {}) : store(complete(std::move(options))) {
        store.addUser("alice", "wonder land");
        store.addUser("bob", "builder");
        store.start();
    }

    // Of a store without access lists: each user alone in the own tree.
    static PrivateStoreOptions plain() {
        PrivateStoreOptions options;
        options.accessLists = false;
        return options;
    }

    PrivateStoreOptions complete(PrivateStoreOptions options) const {
        options.stateDirectory = home.path() + "/store";
        options.ownsProcess = true;
        return options;
    }

    CXDAVAccount account(const std::string& user = "alice") const {
        CXDAVAccount a;
        a.user = UserName(user);
        a.endpoint = store.endpointTemplate();
        a.nameHost = "contacts.example.org";
        a.caFile = store.caFile();
        return a;
    }
    static std::string passwordOf(const std::string& user) { return user == "alice" ? "wonder land" : "builder"; }

    std::shared_ptr<CurlTransport> transport(const std::string& user = "alice",
                                             const std::string& password = {}) const {
        CurlTransportOptions o;
        o.caFile = store.caFile();
        auto t = std::make_shared<CurlTransport>(o);
        t->setCredentials(TransportCredentials{user, password.empty() ? passwordOf(user) : password,
                                               account(user).origins(), TransportCredentials::Scheme::automatic});
        return t;
    }

    // What lies on the server's disk below alice's Contacts.
    std::filesystem::path file(const std::string& relative = {}, const std::string& user = "alice") const {
        return std::filesystem::path(store.userDirectory(user)) / "Contacts" / relative;
    }
    std::string contents(const std::string& relative) const {
        std::ifstream in(file(relative), std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(in), {});
    }

    TempHome home;
    PrivateStore store;
};

// A client of a store world whose requests are recorded.
struct Client {
    explicit Client(const StoreWorld& world, const std::string& user = "alice", const std::string& password = {})
        : wire(std::make_shared<RecordingTransport>(world.transport(user, password))),
          manager(world.account(user), wire), base(manager.account().baseLocationFor(UserName("alice"))) {}

    Url at(const std::string& relative) const {
        Url u = base;
        for (size_t from = 0; from < relative.size();) {
            const size_t slash = std::min(relative.find('/', from), relative.size());
            u = u.cxURLByAppendingComponent(relative.substr(from, slash - from));
            from = slash + 1;
        }
        return u;
    }
    int write(const std::string& relative, const std::string& text) {
        int code = -1;
        manager.write(text, at(relative), true, &code);
        return code;
    }
    int write(const std::string& relative, const Dictionary& d) { return write(relative, PropertyList::toXML(d)); }
    std::pair<int, std::optional<Dictionary>> read(const std::string& relative) {
        int code = -1;
        auto d = manager.dictionaryAtURL(at(relative), false, &code);
        return {code, d};
    }

    std::shared_ptr<RecordingTransport> wire;
    CXDAVManager manager;
    Url base;
};

} // namespace rolvane::test
