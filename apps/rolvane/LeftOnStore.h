#pragma once

#include "contacts/database/CXRolvane.h"
#include "foundation/Preferences.h"
#include "foundation/Url.h"

#include <optional>
#include <string>
#include <vector>

namespace rolvane::cli {

// Files of withdrawn publications that may still be on the store: a removal that ends in the middle leaves what neither
// the database nor the daemon's memory knows of. They are noted, durably, before the database forgets the publication
// and until the last of them is gone, so that whoever publishes or withdraws next takes them away first. One note a
// base location. Only while no daemon runs.
class LeftOnStore {
public:
    LeftOnStore(CXRolvane& database, Preferences& preferences, const Url& base);

    // What is published again, because the withdrawal was never saved, is not left.
    bool anything() const;
    bool isLeft(const UniqueId& group) const;

    void noteTree();
    // `people`: sharing identifiers of those who are in no other published group.
    void noteGroup(const UniqueId& group, const std::vector<UniqueId>& people);
    void forgetTree(); // with all groups
    void forgetGroup(const UniqueId& group);

    struct Failure {
        std::string what; // stands in the middle of a sentence
        int code = 0;     // the store's answer, 0 for none
        std::string answer() const;
    };
    // Has the daemon's memory forget what is noted and takes it off the store, but for people who are in a published
    // group by now. Nothing: all of it is gone. What could not be removed stays noted.
    std::optional<Failure> remove();

private:
    Dictionary note() const;
    void setNote(const Dictionary& note);
    std::optional<Failure> removeTree();
    std::optional<Failure> removeGroup(const UniqueId& group, const Array& people);

    CXRolvane& _database;
    Preferences& _preferences;
    Url _base;
};

// Is anything left, at whatever location?
bool anythingLeftOnStore(CXRolvane& database, Preferences& preferences);

} // namespace rolvane::cli
