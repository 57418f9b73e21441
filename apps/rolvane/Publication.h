#pragma once

#include "contacts/database/CXRolvane.h"
#include "foundation/Preferences.h"
#include "foundation/Url.h"

#include <vector>

namespace rolvane {
class CXDAVManager;
}

namespace rolvane::cli {

// What of the owner's contacts is published, in the contact database. A group, or the all-contacts group, is published
// when it carries the base location under kCXRemoteLocationProperty with the label kCXPublishLabel.
//
// While only single groups are published, the all-contacts group carries that property with no entry in it, and one
// subscription to the location "published-groups" stands in the database: by the first the daemon knows that the owner
// publishes something although not everything, by the second that it has something to do when it starts.
class Publication {
public:
    explicit Publication(CXRolvane& database) : _database(database) {}

    bool everything() const;
    std::vector<CXGroupRef> groups() const;        // published by themselves, by name
    bool publishes(const CXGroupRef& group) const; // by itself
    bool anything() const { return everything() || !groups().empty(); }

    // Each is unsaved. True when it changed something.
    bool publishEverything(const Url& base);
    bool publishGroup(const CXGroupRef& group, const Url& base);
    // With whom the owner shares stays known, for the next publication.
    bool withdrawEverything(); // groups that are published by themselves stay so
    bool withdrawGroup(const CXGroupRef& group);

    // People whose files the store no longer needs when the group is withdrawn: members of the group and of no other
    // published group. Nobody while everything is published. By sharing identifier.
    std::vector<UniqueId> peopleOnlyIn(const CXGroupRef& group) const;

    static constexpr const char* kGroupsLocation = "published-groups";

private:
    void settle(); // the all-contacts group's empty property and the subscription, as the groups ask for them
    CXRolvane& _database;
};

// What the daemon remembers of the owner's publications, in its preferences. Only while no daemon runs.
// Forgets the whole publication and the changes that wait for it.
void forgetPublication(Preferences& preferences);
// Forgets one group and the changes of it that wait.
void forgetPublishedGroup(Preferences& preferences, const UniqueId& group);

} // namespace rolvane::cli
