#pragma once

#include "foundation/Date.h"
#include "foundation/StrongString.h"
#include "foundation/Url.h"
#include "foundation/Value.h"

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace rolvane {

class LocalFiles;

// One entry of a container's listing.
struct FileInfo {
    std::string displayName; // the decoded last path component; never used as a local path
    std::optional<Date>
        modificationdate; // a remote version that was never read: later than the listing, see StoreListing
    uint64_t size = 0;
    EntityTag etag; // empty when the store gives none
    bool isCollection = false;
    bool seen = false;               // remote: this very version was read or written by this client
    std::optional<Date> stored = {}; // remote: the store's own date of the file, read or not
};
// Keyed by path: the decoded path of the entry's URL. Enumerates in byte order of the paths.
using FileListing = std::map<std::string, FileInfo>;

// Reads and writes files, dictionaries and folders at URLs. The base class serves file URLs; http and https URLs go to
// CXDAVManager::defaultManager (whose class serves them itself). Any thread. Nothing throws for what a file or a server
// does; a failure is the absent or false result, with a code where there is an out-argument:
// an HTTP status for remote URLs (0: no believable answer came); for file URLs 200, 404, 403 or 500.
// Local files: a symbolic link in the place of a file or folder is never followed, and only regular files are read and
// written; see LocalFiles.
class CXFileManager {
public:
    CXFileManager();
    // Serves only file URLs below the directory, which other people may write to: no link is followed below it.
    explicit CXFileManager(std::string root);
    virtual ~CXFileManager();

    // The property list dictionary stored at the URL. The code is set in every case when it is given.
    virtual std::optional<Dictionary> dictionaryAtURL(const Url& url, int* errorCode, bool securely);
    // Replaces the file's contents by the text (UTF-8). Local files: not atomic, never secure, the folder must exist.
    virtual bool write(const std::string& text, const Url& url, bool securely);
    // Absence counts as success.
    virtual bool removeDirectoryAndContentsAtURL(const Url& url);
    // The dictionaries at these URLs are going to be read, with `securely`, in this order: what can be fetched ahead
    // is. Each is used for the first reading only. An empty list ends it. Base: nothing is fetched ahead.
    virtual void expectReads(const std::vector<Url>& urls, bool securely);
    // These, too, but in an order that a later expectReads tells; what could not be begun by then is read in its turn.
    virtual void expectSomeReads(const std::vector<Url>& urls, bool securely);
    // What lies in the container, complete or nothing. A remote base location also lists the contact files in the
    // buckets below its "People"; other containers list their own entries only. Entries with hostile names are left
    // out, as are local links, pipes and devices.
    virtual std::optional<FileListing> infoForFilesInContainer(const Url& url);
    // The same; parts of it are told on the way, each entry at most once, perhaps none. Nothing may be concluded from
    // what is missing in them, nor from anything in them when there is no listing in the end.
    using ListingPart = std::function<void(const FileListing& part)>;
    virtual std::optional<FileListing> infoForFilesInContainerByParts(const Url& url, const ListingPart& part);

    // Called, on the thread that needed it, when the network store's password cannot be obtained. One a process; an
    // empty function takes it away.
    static void setFailedPasswordHandler(std::function<void()> handler);
    static void failedToGetPassword(); // calls the handler, if there is one

private:
    std::shared_ptr<const LocalFiles> _local;
};

} // namespace rolvane
