#pragma once

#include "server/StoreProcess.h"

#include <string>
#include <sys/types.h>

namespace rolvane {

// The directories of a store and whose they are. One object serves one launcher; main thread.
//
// An ordinary user owns everything, mode 0700. A launcher that is root keeps the state directory and what it writes
// itself, and httpd's user owns the rest:
//
//   <state>             root       0711   settings, launcher lock, startup.log
//   <state>/conf, tls   root       2750   group of httpd's user, which reads them; files 0640
//   <state>/run, logs, locks, lists, own  httpd's user, 0700
//   <state>/root        root       0711   where the documents lie, unless they are elsewhere
//   <documents>/dav     httpd's user      everything in it is made as that user
//
// So httpd's user cannot put anything in the place of a file that root writes. Every directory is opened step by step,
// no symbolic link is followed, and what changes hands does so by its descriptor. Nothing that httpd's user owns is
// walked. A store that an earlier version left to httpd's user is taken back, and refused where something in it is a
// link: every operation throws kCXPrivateStoreException, which names the place.
class StorePlaces {
public:
    StorePlaces(std::string state, std::string documentRoot, const StoreIdentity& identity);

    void make() const;                          // all but the users' directories; what is there stays
    void makeForUser(const std::string&) const; // <documents>/dav/<user>, empty, mode 0700
    // Of the files in conf and tls that httpd reads and nobody else.
    static mode_t fileMode(const StoreIdentity& identity) { return identity.change ? 0640 : 0600; }

private:
    void makeAsRoot() const;

    const std::string _state, _documents;
    const StoreIdentity& _identity;
};

// The text of a file that httpd's user may have written, at most its last `most` bytes. A symbolic link, a file with a
// second name and anything else that is no regular file is read as ""; so is a missing file.
std::string textOfServersFile(const std::string& path, size_t most);

} // namespace rolvane
