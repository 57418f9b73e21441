#pragma once

#include "foundation/Date.h"
#include "foundation/Notification.h"
#include "foundation/StrongString.h"
#include "foundation/Url.h"
#include "foundation/Value.h"
#include "store/account/Account.h"
#include "store/files/CXFileManager.h"
#include "store/http/HttpTransport.h"
#include "store/http/RequestFailures.h"

#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class ListingMemory;

// Why the store cannot be used. `code` 0: no error was produced.
struct CXDAVError {
    int code = 0;
    std::string reason; // a sentence for a person
};
inline constexpr int kCXDAVErrorTimedOut = -1001;
inline constexpr int kCXDAVErrorCannotConnect = -1004;
inline constexpr int kCXDAVErrorBadServerResponse = -1011; // whoever answered is not a WebDAV server
inline constexpr int kCXDAVErrorNoPassword = -1013;        // the password cannot be had from its source
inline constexpr int kCXDAVErrorAuthentication = -1012;    // the account's user name or password was refused
inline constexpr int kCXDAVErrorSecureConnection = -1200;
inline constexpr int kCXDAVErrorNoAccount = -1100; // no account, or one that cannot be used

// The client of one account's network store. URLs given to it are names (remote locations and what lies below them);
// it knows where the bytes are. Any thread; operations wait for the server, at most the transport's deadlines.
//
// Result codes are the server's own HTTP status; 0 when no answer came or the answer cannot be believed (whoever
// answered is not a WebDAV server: a captive portal or a proxy; see ExpectedAnswer). Refusals come only from a server
// that answered OPTIONS with "DAV: 1". A 207 to PUT, DELETE or MKCOL is a failure. Of a tree's "info", 403 and 404 are
// what the store has said twice.
//
// Conditional writes: when a thread reads the dictionary at a URL and its next operation on a dictionary is a write to
// the same URL, the write goes through only if the file is still the one that was read (or still absent); otherwise
// it fails with 412. When that read
// failed for another reason than absence, the write is not sent and fails with code 0: what is there is not known.
// Where the store holds just what was to be written, the write has succeeded.
//
// A URL may be a group's state file and its directory at once: the dictionary of a collection lies inside it under
// kStateName, and a file in the way of a collection is moved there when the collection is made. Listings show one
// entry.
class CXDAVManager : public CXFileManager {
public:
    struct Impl;                                        // shared with the locks made from this client
    static constexpr const char* kStateName = ".state"; // never a group's, person's or structure file's name

    // Where the versions of files are remembered from run to run; empty: in memory only.
    struct VersionsFile {
        std::string path;
    };

    // Credentials are fetched from the account's password source on first need.
    explicit CXDAVManager(CXDAVAccount account); // over a CurlTransport of its own
    CXDAVManager(CXDAVAccount account, VersionsFile versions);
    // Over the given transport, which signs in.
    CXDAVManager(CXDAVAccount account, std::shared_ptr<HttpTransport> transport);
    CXDAVManager(CXDAVAccount account, std::shared_ptr<HttpTransport> transport, VersionsFile versions);
    ~CXDAVManager() override;

    // -- the process's own client, built from the saved account on first use; never null. Without an account (or with
    // one that cannot be used) user, password and address are empty and every operation fails.
    static CXDAVManager& defaultManager();
    static void setDefaultManager(std::shared_ptr<CXDAVManager> manager); // tests; null: build anew on next use
    static std::string vaultraUser();
    static std::string password();        // "" when it cannot be had; the failed-password handler is then called
    static std::string ostrelUserAgent(); // "Rolvane/<version>"
    static std::string vaultraAddress();  // the endpoint's host
    static bool canReachOstrelError(CXDAVError& error);
    static Url ostrelBaseLocationForOstrelUser(const UserName& user);
    static void updateConfigDataIfNeeded(); // reads the configuration anew when its file changed
    // The entry of the daemon's preferences domain, else of the application's, else of configDirectory()/config.plist,
    // else the default.
    static Value configValueForKey(const std::string& key, Value defaultValue);

    // -- the same for one client
    // `meanwhile`: called when the requests that find it out can be sent, for others to go along with them.
    bool canReach(CXDAVError& error, const std::function<void()>& meanwhile = {});
    const CXDAVAccount& account() const;
    HttpTransport& transport();
    // The requests whose answers made an operation fail. A 404 to the question whether something is there is none.
    RequestFailures& failures();

    // -- files
    bool write(const std::string& text, const Url& url, bool securely) override;
    bool write(const std::string& text, const Url& url, bool securely, int* code);
    std::optional<Date> modDateForURL(const Url& url); // the server's, to the second
    std::optional<Dictionary> dictionaryAtURL(const Url& url, bool securely, int* code);
    // The same, with what is known of the version.
    struct Version {
        std::optional<Dictionary> contact; // none: absent, failed, or no dictionary
        bool isKnown = false;              // it is the version that this client read or wrote last before
        std::optional<Date> lastModified;  // by the server's clock, to the second
        bool failed = false;               // whether anything is there was not learnt
    };
    Version readVersion(const Url& url, bool securely, int* code);
    bool remembersVersion(const Url& url) const; // some version of the file, read or written at any time
    // The next write of this thread, if it is to this file, is refused with 412 where something else lies there already
    // (RFC 9110 section 13.1.2). Sends nothing.
    void expectAbsence(const Url& url, bool securely);
    std::optional<Dictionary> dictionaryAtURL(const Url& url, int* errorCode, bool securely) override;
    bool removeFileAtURL(const Url& url, int* code); // a file or a collection with its contents; absence: 404, true
    bool removeDirectoryAndContentsAtURL(const Url& url) override;
    bool createDirectoryAtAURL(const Url& url); // true when it is there afterwards
    std::optional<FileListing> infoForFilesInContainer(const Url& url) override;
    std::optional<FileListing> infoForFilesInContainerByParts(const Url& url, const ListingPart& part) override;
    void expectReads(const std::vector<Url>& urls, bool securely) override;
    void expectSomeReads(const std::vector<Url>& urls, bool securely) override;
    // The container is going to be listed once, soon: what is asked first of the store is asked now.
    void expectListing(const Url& url);
    // A tree that the next pass would list whole may be listed before it, while other passes write: the next listing
    // then asks for the changes since alone. False also where the store tells no changes, as nothing would be kept.
    bool isToBeListed(const Url& tree) const;
    // Lists it, and waits for the store. Null when that could not be done. Any thread.
    std::unique_ptr<ListingMemory> listAhead(const Url& tree);
    // Keeps such a listing, unless the tree was listed meanwhile. False: the tree is to be listed all the same.
    bool keepListing(const Url& tree, std::unique_ptr<ListingMemory> listed);
    // Nothing is expected any more, listings included; what was fetched ahead is forgotten.
    void expectNothing();

    // While one lives, dictionaryAtURL of a group whose file is, in a listing made meanwhile, still the version that
    // this client read or wrote last gives that content without asking the store. One at a time.
    class Snapshot {
    public:
        explicit Snapshot(CXDAVManager& manager);
        ~Snapshot();
        Snapshot(const Snapshot&) = delete;
        Snapshot& operator=(const Snapshot&) = delete;

    private:
        std::shared_ptr<Impl> _impl;
    };

    // Checks the account's own tree: the tree, "People" and its 32 buckets, "info" with "SerialNumber", "dateFile".
    // One request when all is there. With `create` what is missing is made; nothing that exists is written again.
    // True when the structure is complete afterwards.
    bool sanityCheckPublishStructureCreate(bool create);
    // A mark of a listed tree: equal numbers say that neither the store nor this client's knowledge of the tree's
    // versions has changed, but for the clock file. Only in this process.
    struct TreeMark {
        uint64_t listing = 0, versions = 0;
        bool operator==(const TreeMark&) const = default;
    };
    // `ask`: the store is asked what has changed; the next listing of the tree in this pass is then made of that. None
    // where the store does not tell, or the tree was not listed yet.
    std::optional<TreeMark> markOfTree(const Url& tree, bool ask);
    // The contact files that would stand differently in a listing than in one at that mark, after the store was
    // asked for the present mark; and `others`. Nothing where one of them is not there, or where anything else of
    // the tree may be different, too.
    std::optional<FileListing> contactsChangedSince(const Url& tree, const TreeMark& mark,
                                                    const std::vector<Url>& others);
    // The dates of the tree's own files ("info", "dateFile"), as of the last listing.
    std::map<std::string, Date> datesOfTree(const Url& tree);
    // This client has found it whole, or made it, and nothing has spoken against it since.
    bool knowsPublishStructure() const;
    // The serial number that the account's own tree is known by; "" for none. A tree that has lost it gets it again.
    void keepSerialNumber(const std::string& serial);
    // True: missing parts of the own tree are made. A tree that is gone altogether is not made again.
    void mendOwnTreeOnly(bool mendOnly);

    // -- access lists (RFC 3744), as account names: who may read, and who may write. A name with the scheme https is
    // asked about over TLS whatever the account says. See StoreAccessLists for what else a list may hold.
    //
    // Whether the store keeps access lists, as it last said; nothing when it does not answer. Plain WebDAV servers keep
    // none.
    std::optional<bool> keepsAccessLists();
    // False, and the lists untouched, when the store keeps none there, does not show them, or gives no whole answer.
    virtual bool ACLsAtURL(const Url& url, std::vector<std::string>& readers, std::vector<std::string>& writers);
    // True when the store has the lists. What was changed there by others since this client saw the list stays; nothing
    // is sent when the caller changed nothing since then, or when what is there cannot be read. A name that the store
    // does not know is logged and left out, and gives false. "<self>" and the account's own user need no entry.
    virtual bool setACLsWithReadPrincipals(const std::vector<std::string>& readers,
                                           const std::vector<std::string>& writers, const Url& url);

    // Which versions of files are known, so that they need not be read again, counts for the contact database that has
    // what was read: named by its identity, and by how many passes it has seen (its share count). To be said before
    // anything is listed.
    void useVersionMemoryOf(const std::string& database, int64_t passes);
    // Writes it down, when the database has what was read. A client that ends does not, as its last pass may have
    // failed. Losing it costs reads only.
    void saveVersionMemory(const std::string& database, int64_t passes);
    // The database could not keep what was read since.
    void revertVersionMemory();
    // Keeps what saves the next process requests; of a client that was told of a database. To be called once, when
    // nothing is under way that anybody waits for.
    void processEnds() const noexcept;
    // The next listing gives the file as one that was not seen yet, so that it is read once more.
    void forgetVersion(const Url& url);

    // The machine has another network: connections that stand are not used again.
    void networkChanged();

    // -- ending: every request under way and every later one fails at once. From any thread or a signal handler.
    void abortAll();

    const std::shared_ptr<Impl>& impl() const { return _impl; }

private:
    std::shared_ptr<Impl> _impl;
};

} // namespace rolvane
