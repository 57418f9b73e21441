#pragma once

#include "FakeHttpServer.h"

#include <atomic>
#include <map>
#include <mutex>
#include <set>
#include <string>

namespace rolvane::test {

// What a server does otherwise than the standard, or than most do. Each is the habit of some server that people have.
struct Oddities {
    bool redirectsToSlash = false;            // 301 to the name of a collection without its slash, whatever the method
    bool wantsSlash = false;                  // MKCOL and DELETE of a collection without it are 409
    std::string davHeaders = "DAV: 1, 2\r\n"; // of OPTIONS, header lines
    int optionsOfMissing = 200;          // what OPTIONS of a place is answered with where nothing is; 0: not at all
    bool dates = true, isoDates = false; // getlastmodified, and Last-Modified
    bool dateHeader = true;              // the header of every answer
    bool tags = true, weakTags = false;  // getetag, and ETag
    bool namesItself = true;             // a listing begins with the collection itself
    bool statuses = true;                // a propstat has its status
    int multistatus = 207;
    std::string doctype;     // before a multistatus
    std::string hrefOrigin;  // before the path in every href, as behind a proxy
    std::string encoding;    // of every body: "gzip" is made, others are only said
    int ifWithTag = 0;       // the answer to every If that holds an entity tag, whatever lies there
    int ifNoneMatch = 0;     // the same to every If-None-Match
    int lockGranted = 200;   // 5xx: the lock stands all the same
    bool tellsLocks = true;  // lockdiscovery
    int deleted = 204;       // 207: a multistatus in which all is well
    int mkcol = 0;           // the answer to every MKCOL
    int put = 0;             // the answer to every PUT
    bool makesAgain = false; // MKCOL of a collection that is there is 201
};

// A small WebDAV server in memory, over real sockets, with habits. Depth 0 and 1, exclusive locks of one resource.
class OddServer {
public:
    explicit OddServer(Oddities oddities = {});

    std::string origin() const { return _http.origin(); }
    std::string endpointTemplate() const { return origin() + "/dav/{user}/Contacts"; }
    std::vector<FakeRequest> requests() const { return _http.requests(); }
    size_t count(const std::string& method) const;
    void be(Oddities oddities); // from now on
    Oddities habits() const;

    // By decoded path, "/dav/alice/Contacts/x"; collections are in the second.
    std::map<std::string, std::string> files() const;
    std::set<std::string> collections() const;
    std::set<std::string> locked() const;
    void write(const std::string& path, const std::string& text); // as another client does
    void makeCollection(const std::string& path);

private:
    struct File {
        std::string text;
        int version = 0;
    };
    FakeAnswer answer(const FakeRequest& request);
    FakeAnswer answerTo(const FakeRequest& request, const std::string& path, bool slash);
    FakeAnswer put(const FakeRequest& request, const std::string& path);
    FakeAnswer listing(const FakeRequest& request, const std::string& path);
    FakeAnswer lock(const FakeRequest& request, const std::string& path);
    FakeAnswer transfer(const FakeRequest& request, const std::string& path);
    FakeAnswer said(int status, const std::string& body = {}, const std::string& headers = {}) const;
    std::string entry(const std::string& path) const;
    std::string tagOf(const File& file) const;
    bool exists(const std::string& path) const { return _files.contains(path) || _collections.contains(path); }
    void removeBelow(const std::string& path);

    mutable std::mutex _mutex; // guards the following
    Oddities _odd;
    std::map<std::string, File> _files;
    std::set<std::string> _collections{"", "/dav"};
    std::map<std::string, std::string> _locks; // token by path
    int _last = 0;
    FakeHttpServer _http; // the last: its threads use the others
};

} // namespace rolvane::test
