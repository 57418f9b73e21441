#pragma once

#include "foundation/Value.h"

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace rolvane {

// Unwritten changes of a domain by key; no bytes: removal.
using PreferencesChanges = std::map<std::string, std::optional<Bytes>, std::less<>>;

// Keeps some keys of one domain in another file than the preferences', with what they belong to. Called with the
// lock of the preferences held. Failures throw CXException.
class PreferencesKeeper {
public:
    virtual ~PreferencesKeeper() = default;
    virtual bool keeps(std::string_view domain, std::string_view key) const = 0; // the same answer always
    virtual const std::string& domain() const = 0;
    virtual std::optional<Bytes> read(std::string_view key) = 0;
    virtual std::vector<std::string> keys() = 0;
    virtual void write(const PreferencesChanges& changes) = 0; // one transaction, durable on return
};

// Preferences: a row per domain and key in one SQLite file (synchronous=FULL). Writes and removals are kept in memory,
// visible to this process's reads at once, until `synchronize` writes them in one transaction; reads of keys that have
// no unwritten change see what other processes have synchronised. Values are BinaryValue blobs. Any thread.
// A damaged file throws kCXPreferencesException that names the file and says how to go on; it is never overwritten.
// A value whose bytes are damaged throws kCXArchiveException when it is asked for, and is left as it is, too.
// A locked file (after the lock timeout), a read-only one and a full disk are reported like a damaged file: nothing of
// the transaction is written, and the changes stay in memory for the next `synchronize`. Several processes may use one
// file at a time. A value is copied when it is set: what happens to its containers afterwards changes nothing here.
class Preferences {
public:
    // The file is made on the first write, mode 0600, directories 0700. Nothing is opened before it is needed.
    explicit Preferences(std::string path, double lockTimeoutSeconds = 4);
    Preferences(std::string path, std::shared_ptr<PreferencesKeeper> keeper) : Preferences(std::move(path)) {
        keepElsewhere(std::move(keeper));
    }
    ~Preferences();
    Preferences(const Preferences&) = delete;
    Preferences& operator=(const Preferences&) = delete;

    Value get(std::string_view domain, std::string_view key) const;          // absent when there is none
    void set(std::string_view domain, std::string_view key, Value value);    // an absent value removes
    void setData(std::string_view domain, std::string_view key, Bytes data); // as a data value, which is not copied
    void remove(std::string_view domain, std::string_view key);
    void synchronize(std::string_view domain);
    std::vector<std::string> keys(std::string_view domain) const; // in byte order, unwritten changes included
    std::vector<std::string> domains() const;                     // those with a key, in byte order
    const std::string& path() const;

    // From now on the keeper has its keys. Values that an earlier version left in the file move to it with the first
    // use, and are read where they are as long as they cannot move.
    void keepElsewhere(std::shared_ptr<PreferencesKeeper> keeper);

    // While it lives, synchronize leaves the keeper's keys unwritten: their owner writes them together with something
    // else. Destroying it drops what is unwritten of them: what is stored counts again. One at a time.
    class Hold {
    public:
        explicit Hold(Preferences& preferences);
        ~Hold();
        Hold(const Hold&) = delete;
        Hold& operator=(const Hold&) = delete;

        PreferencesChanges changes() const; // of the keeper's keys
        void end();                         // they are written; no hold any more

    private:
        Preferences& _preferences;
        bool _holds = true;
    };

    // stateDirectory()/preferences.db, found anew at every call: one object a path, living for the process.
    static Preferences& shared();

private:
    struct Impl;
    std::unique_ptr<Impl> _impl;
};

inline constexpr const char* kDaemonDomain = "net.rolvane.RolvaneManager";
inline constexpr const char* kApplicationDomain = "net.rolvane.Rolvane"; // the contact application's

} // namespace rolvane
