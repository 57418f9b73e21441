#pragma once

#include "contacts/database/CXRolvane.h"
#include "support/ChildProcess.h"
#include "support/TempHome.h"

#include "../server/RawHttp.h"

#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

// One DAV:response of a multistatus.
struct BookResponse {
    std::string href;
    int status = 0; // of the whole response, 0 where it has properties
    std::string text;

    std::string property(const std::string& element) const; // what stands in the element, with the prefix that it has
    bool has(const std::string& element) const;
    std::string card() const; // C:address-data, without its escapes
};

struct BookAnswer {
    int status = 0;
    std::string headers, body;
    bool whole = false; // the body came to its end

    std::string header(const std::string& name) const;
    std::string tag() const { return header("ETag"); }
    std::vector<BookResponse> responses() const;
    const BookResponse* find(const std::vector<BookResponse>& all, const std::string& href) const;
    std::string syncToken() const;
    std::string precondition() const; // the name of the child of DAV:error, "" when there is none
};

// A contact database with Debian's httpd in front of it, which serves its books at /books on a loopback port.
// Everything is in a directory of its own. The test's own program writes into the database as any other of the person's
// would.
class BooksWorld {
public:
    struct Options {
        std::string directives = {}; // further ones of the server
        bool sanitized = false;      // the module that was built with sanitizers
        bool signedIn = true;        // a section that asks who it is
        std::vector<std::string> devices = {"laptop", "phone"};
    };
    BooksWorld() : BooksWorld(Options{}) {}
    explicit BooksWorld(Options options);
    ~BooksWorld();
    BooksWorld(const BooksWorld&) = delete;

    CXRolvane& rolvane() { return *_rolvane; }
    CXPersonRef addPerson(const std::string& first, const std::string& last, const Dictionary& more = {});
    CXGroupRef addGroup(const std::string& name, const std::vector<CXPersonRef>& members);
    // A subscription with one person that came by it.
    CXSubscriptionRef addSubscription(const std::string& location, bool writable, const std::string& first);

    using Headers = std::vector<std::pair<std::string, std::string>>;
    BookAnswer ask(const std::string& method, const std::string& path, const Headers& headers = {},
                   const std::string& body = {}, const std::string& device = "laptop") const;
    BookAnswer propfind(const std::string& path, int depth, const std::string& properties) const;
    BookAnswer report(const std::string& path, const std::string& body) const;
    BookAnswer sync(const std::string& path, const std::string& token, const std::string& more = {}) const;
    BookAnswer multiget(const std::string& path, const std::vector<std::string>& hrefs,
                        const std::string& data = "<C:address-data/>") const;
    BookAnswer put(const std::string& path, const std::string& card, const Headers& headers = {},
                   const std::string& device = "laptop") const;

    void restart(bool kill = false);
    void killWorkers() const; // their parent starts new ones
    int port() const { return _port; }
    std::string log() const;
    std::string database() const { return _directory / "contacts.db"; }
    std::string path(const std::string& name) const { return _directory / name; }
    pid_t server() const { return _process->pid(); }

    static std::string uuidOf(const CXRecordRef& record);

private:
    void start();
    void stop(bool kill);

    test::TempDirectory _directory;
    int _port;
    const bool _isSanitized;
    std::unique_ptr<CXRolvane> _rolvane;
    std::unique_ptr<test::ChildProcess> _process;
};

inline constexpr const char* kContacts = "/books/home/contacts/";

// A card of version 3.0 with these lines behind N and FN.
std::string cardOf(const std::string& uid, const std::string& first, const std::string& last,
                   const std::string& lines = {});

} // namespace rolvane
