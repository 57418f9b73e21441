#pragma once

#include "contacts/records/CXRecord.h"

namespace rolvane {

class CXGroup;
class CXPerson;
using CXPersonRef = std::shared_ptr<CXPerson>;
using CXGroupRef = std::shared_ptr<CXGroup>;

// A person of the owner's own.
class CXPerson : public CXRecord {
public:
    static CXPersonRef create();                              // fresh identifier, in no database yet
    static CXPersonRef initWithUniqueId(const UniqueId& uid); // will carry the identifier; CXSubscribedPerson by table
    // A person made of a dictionary. With a database it is added to it; without (null) it is transient.
    static CXPersonRef personFromDictionary(const Dictionary& dictionary, CXRolvane* rolvane,
                                            bool skipUnknownProperties, bool generateMultiValueIDs);
    static CXSearchElement searchElementForProperty(std::string_view property, std::string_view label,
                                                    std::string_view key, Value value, int comparison);

    // The groups that list the person, oldest group first; the all-contacts group is not among them.
    std::vector<CXGroupRef> parentGroups() const;
    std::vector<UniqueId> parentGroupUniqueIds() const; // the same as identifiers, one query
    // What a list shows: the formatted name, else the parts, else organisation, nickname, first mail; never empty.
    std::string displayName() const;

protected:
    using CXRecord::CXRecord;
    friend class CXRolvane;
};

// A copy of somebody else's person that came by a subscription.
class CXSubscribedPerson : public CXPerson {
public:
    static CXPersonRef initWithUniqueId(const UniqueId& uid);
    static CXSearchElement searchElementForProperty(std::string_view property, std::string_view label,
                                                    std::string_view key, Value value, int comparison);

protected:
    using CXPerson::CXPerson;
    friend class CXPerson;
    friend class CXRolvane;
};

// The same from a bare dictionary.
std::string cxDisplayName(const Dictionary& properties);

} // namespace rolvane
