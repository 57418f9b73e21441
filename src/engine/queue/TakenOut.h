#pragma once

#include "model/CXDChangeRecord.h"

#include <compare>
#include <functional>
#include <optional>
#include <unordered_map>
#include <utility>
#include <vector>

namespace rolvane {

struct GroupThatIsGone {
    UserName user;
    UniqueId group; // as the store names it
    auto operator<=>(const GroupThatIsGone&) const = default;
};

// What one side takes out of a publication while the other side changes it is out: a contact or group cannot be left
// half there, changed on the store and gone from the database or the other way round. Whose change it is does not
// matter here: records from the store of one's own publication carry the owner's name, whoever wrote them.
//
// Made of a pass's records before mingling, without what the database swallows. Costs one walk when nothing is taken
// out, and in any case O(records).
class TakenOut {
public:
    TakenOut() = default;
    explicit TakenOut(const CXDChangeRecords& records);

    // Drops the records of the other side about what is out. But for those that bring changes of somebody else's
    // publication: that the removal made here is let through there is not known yet. Gives the groups in which changes
    // were made here for nothing: somebody has to be told.
    //
    // A store's records are dropped, too, about whom that store itself takes out: groups there name a contact, or a
    // number of it, for some time behind its deletion. Mingling would take such a record for the later word.
    std::vector<GroupThatIsGone> drop(CXDChangeRecords& records) const;

    // True of a record about what the other side takes out.
    bool concerns(const CXDChangeRecord& record) const;

private:
    struct Hash {
        size_t operator()(const std::pair<UserName, UniqueId>& of) const {
            return std::hash<UserName>{}(of.first) * 31 + std::hash<UniqueId>{}(of.second);
        }
    };
    bool isLeftBehindThere(const CXDChangeRecord& record) const;
    bool isTakenOutByOthers(const CXDChangeRecord& record, const std::optional<UniqueId>& uid) const;
    void forgetAdditions(CXDChangeRecord& composite) const;

    std::unordered_map<std::pair<UserName, UniqueId>, int32_t, Hash>
        _sources; // that take it out; as the store names it
};

} // namespace rolvane
