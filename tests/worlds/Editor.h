#pragma once

#include "Chance.h"
#include "Report.h"
#include "contacts/database/CXRolvane.h"

#include <functional>
#include <string>
#include <vector>

namespace rolvane::worlds {

// The kinds of edits that people of a world make, by weight.
struct Habits {
    size_t text = 30, phone = 12, make = 9, remove = 7, makeGroup = 4, removeGroup = 2, rename = 6, join = 12,
           leave = 8, nest = 4, unnest = 3, turn = 3, removeAll = 0;
    size_t most = 4;       // edits in one save
    double choose = 0.25;  // of saves that also say which phone of a member a group uses
    bool leaveOne = false; // the last contact stays
};

// The cells of a contact's phones: all marks of one root, in order, with spaces between them.
void readPhones(const std::optional<CXMultiValue>& phones, const std::string& whose, Cells& cells,
                std::vector<std::string>& faults);

// One person at a contact application: edits the copy of the tree in a database as a person would, at random, and
// tells each deed once it is saved.
class Editor {
public:
    // `location`: of the copies that came by a subscription; empty: the person's own. `stamp` goes into every mark and
    // identifier, so that they are never used twice.
    Editor(char who, CXRolvane& database, RemoteLocation location, uint64_t seed, std::string stamp, Report& report)
        : _who(who), _database(database), _location(std::move(location)), _chance(seed), _stamp(std::move(stamp)),
          _report(report) {}

    void makeAtFirst(size_t people, size_t groups);
    void edit(const Habits& habits); // a few edits and one save, or several
    // One kind of edit of several records, in one save.
    void makePeople(size_t count);
    void changePhoneOfThose(const std::string& stamp); // the first phone of those who were made with that stamp
    void takeBack(const std::string& stamp);           // contacts and groups that were made with that stamp

    static View view(CXRolvane& database, const RemoteLocation& location);

private:
    struct Kind {
        size_t weight;
        std::function<void()> make;
    };
    std::vector<CXPersonRef> people() const;
    std::vector<CXGroupRef> groups() const;
    CXPersonRef anybody();
    CXGroupRef anyGroup();
    bool wasMadeWith(const std::string& mark, const std::string& stamp) const;
    void changePhone(CXPerson& person);
    std::string freshMark();
    UniqueId freshName(std::string_view table);
    void placeHere(CXRecord& record);

    void setText();
    void changePhones();
    void makePerson();
    void remove(const CXRecordRef& record);
    void removeAnybody(bool leaveOne);
    void removeAll();
    void makeGroup();
    void rename();
    void join(const CXGroupRef& group, const CXPersonRef& person);
    void leave();
    bool nest(const CXGroupRef& outer, const CXGroupRef& inner);
    void unnest(bool turned);
    void choose(Chance chance);
    void addPhone(CXPerson& person);
    void note(Deed::Kind kind, const CXRecord& record, std::string cell = {}, std::string before = {},
              std::string after = {});
    void save();

    const char _who;
    CXRolvane& _database;
    const RemoteLocation _location;
    Chance _chance;
    const std::string _stamp;
    Report& _report;
    size_t _count = 0;
    std::vector<Deed> _unsaved;
};

} // namespace rolvane::worlds
