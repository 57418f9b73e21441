#pragma once

#include "foundation/StrongString.h"
#include "foundation/Url.h"
#include "foundation/Value.h"

#include <string>
#include <vector>

namespace rolvane {

// Tells whose a location is. The engine answers; declared here so that a manager can know whether it is the
// publisher's.
class LocationOwner {
public:
    virtual ~LocationOwner() = default;
    virtual UserName userForRemoteLocation(const RemoteLocation& location) const = 0; // kSelf for the owner's own
};

// The access list of one published base location: readers and all-access principals, in order, without duplicates.
// Principals are account names; "<self>" stands for the current user. One thread at a time.
class CXACLManager {
public:
    // initWithBaseLocation:. The constructors of the subclasses load; here there is nothing to load.
    CXACLManager(Url baseLocation, const LocationOwner& owner);
    virtual ~CXACLManager() = default;

    virtual bool load();     // base: false, nothing loaded
    virtual bool validate(); // base: true
    virtual bool save();     // base: what validate says
    // The changes that no save has carried yet, in their order, each a dictionary. What another process could not save
    // is gone on with by `resume`. Base: nothing is kept.
    virtual Array unsaved() const { return {}; }
    virtual void resume(const Array& /*changes*/) {}
    // Whether the lists say what is kept, so that they may be compared; base: true.
    virtual bool isKnown() const { return true; }

    const Url& baseLocation() const { return _baseLocation; }
    bool publisher() const { return _publisher; }
    const std::vector<UserName>& principalsWithReadAccess() const { return _readAccessPrincipals; }
    const std::vector<UserName>& principalsWithAllAccess() const { return _allAccessPrincipals; }

    void grantPrincipal(const UserName& principal, bool allAccess); // one list only
    void denyPrincipal(const UserName& principal, bool allAccess);  // one list only
    void grantReadPermissionForGUID(const UniqueId& guid, const std::vector<UniqueId>& members,
                                    const UserName& toAccount);
    void grantReadWritePermissionForGUID(const UniqueId& guid, const std::vector<UniqueId>& members,
                                         const UserName& toAccount);
    void denyReadPermissionForGUID(const UniqueId& guid, const std::vector<UniqueId>& members,
                                   const UserName& toAccount);
    void denyReadWritePermissionForGUID(const UniqueId& guid, const std::vector<UniqueId>& members,
                                        const UserName& toAccount);

    std::vector<Url> affectedURLsForGUID(const UniqueId& guid, const std::vector<UniqueId>& members) const;
    std::vector<Url> bucketURLs() const;
    std::vector<Url> otherStructureURLs() const;
    // "0".."31": MD5 of the identifier's bytes, as many as it has UTF-16 units; first digest byte, low five bits.
    static std::string bucketNameForUID(const UniqueId& uid);
    virtual std::string description() const;

protected:
    virtual const char* className() const { return "CXACLManager"; }
    // A grant or denial, as it was asked for.
    struct Change {
        UserName principal;
        bool allAccess;
        bool grant;
        bool oneListOnly;
        bool operator==(const Change&) const = default;
    };
    // Called for each change before it is carried out, whether it changes a list or not.
    virtual void willChange(const Change& /*change*/) {}
    void carryOut(const Change& change); // without calling willChange

    Url _baseLocation;
    bool _publisher;
    std::vector<UserName> _readAccessPrincipals;
    std::vector<UserName> _allAccessPrincipals;

private:
    void make(const Change& change);
    void _grant(bool grant, const UniqueId& guid, const std::vector<UniqueId>& members, const UserName& toAccount,
                bool readWrite);
};

} // namespace rolvane
