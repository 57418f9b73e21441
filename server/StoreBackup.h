#pragma once

#include "server/PrivateStore.h"

#include <string>

namespace rolvane {

// Everything that a store cannot make again, as one archive that tar reads: lists, accounts, passwords that users
// chose, quotas, certificates, and the trees. A store may run while it is written: each file in it is whole, and files
// of one tree may be of moments that lie seconds apart, as after a client that was interrupted. The clients' daemons
// mend that. One thread. Every operation throws kCXPrivateStoreException.
class StoreBackup {
public:
    explicit StoreBackup(const PrivateStoreOptions& options);

    // To a file of mode 0600, which gets its name when it has been read back, or to standard output ("-").
    void write(const std::string& file) const;
    // The same in a directory, by the name rolvane-store-DATE.tar.gz; of the files with such names the `keep` youngest
    // stay, all with 0. Returns the path.
    std::string writeInto(const std::string& directory, int keep) const;
    // Replaces the store by the archive ("-": standard input). The store must not run. Returns the directory that holds
    // the former one.
    std::string restore(const std::string& file) const;

private:
    const PrivateStoreOptions _options; // with all directories
};

} // namespace rolvane
