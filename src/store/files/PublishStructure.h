#pragma once

#include "foundation/Mutex.h"
#include "store/files/StoreFiles.h"
#include "store/http/StoreSession.h"

#include <atomic>

namespace rolvane {

// The tree that a publisher needs on the store: the tree itself, "People", and then all at once its buckets "0" to
// "31", "dateFile" and "info". One listing tells that a tree has been made. Whoever is ended while making it may leave
// buckets out: when a write finds a folder missing, everything is looked at. Any thread.
class PublishStructure {
public:
    PublishStructure(StoreSession& session, StoreFiles& files) : _session(session), _files(files) {}

    bool check(bool create);
    // The last check has found or made everything, and no write has missed a folder since.
    bool isKnown() const { return _isKnown && !_doubtful; }
    // After a write found a folder missing: makes what is missing. One thread at a time does it, the others wait.
    bool repair();
    // What a lost "info" is to say again; "" for a new number. A tree that is made anew under its old number is filled
    // by its owner, and nobody takes it for another tree.
    void keepSerialNumber(std::string serial);
    // True: a tree that has lost both "info" and "People" has been withdrawn by another computer of its owner,
    // and is not made anew.
    void mendOnly(bool mendOnly) { _mendOnly = mendOnly; }

private:
    struct Missing {
        bool known = false; // the store gave an answer that can be believed
        bool tree = false, people = false, dateFile = false, info = false;
        std::vector<int> buckets;
        bool operator==(const Missing&) const = default;
        bool anything() const { return tree || people || dateFile || info || !buckets.empty(); }
    };
    Missing look(bool everything);
    bool checkNow(bool create) REQUIRES(_mutex);
    bool complete(const Missing& missing) REQUIRES(_mutex);
    bool makeTree();
    HttpRequest making(const Url& collection) const;
    HttpRequest writingNew(const Url& name, const std::string& text) const;
    bool makeAll(std::vector<HttpRequest> requests);
    bool writtenWithoutCondition(HttpRequest request, const HttpResponse& answer);
    Url base() const { return _session.account().baseLocationFor(_session.account().user); }

    StoreSession& _session;
    StoreFiles& _files;
    Mutex _mutex; // one completion at a time
    std::string _serial GUARDED_BY(_mutex);
    std::atomic<bool> _doubtful{false}, _isKnown{false}, _mendOnly{false};
};

} // namespace rolvane
