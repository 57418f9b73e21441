// The half of the network store's conduit that judges trees: whether a state is to be believed, and what mends the
// owner's.

#include "conduits/store/CXDVaultraConduit.h"

#include "conduits/EditsAlone.h"
#include "conduits/PublishedLayout.h"
#include "conduits/TakingIn.h"
#include "conduits/store/EndedPublication.h"
#include "conduits/store/StoreComparison.h"
#include "conduits/store/TreeCondition.h"
#include "contacts/database/CXRolvane.h"
#include "contacts/database/DamagedDatabase.h"
#include "contacts/records/Constants.h"
#include "contacts/records/Identifier.h"
#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Preferences.h"
#include "foundation/TestSwitch.h"
#include "model/PayloadKeys.h"
#include "model/RemoteLocationMap.h"

#include <algorithm>
#include <map>
#include <set>
#include <utility>

namespace rolvane {
namespace {

// In the prior state of the owner's tree: something was amiss there that may be so for a moment only.
constexpr const char* kLookAgain = "LookAgain";
// In kPublishAgain: what a list of everybody would say that was lost, where several computers write it.
constexpr const char* kLostList = "lostList";

// People and groups of a tree's list of everybody.
class ListedRecords {
public:
    explicit ListedRecords(const Dictionary& state)
        : _people(state, kMemberUIDState), _groups(state, kSubgroupUIDState) {}
    bool contains(const UniqueId& record) const {
        const UniqueId shared = cxNormalizedUID(record);
        return _people.contains(shared) || _groups.contains(shared);
    }

private:
    const ListedNames _people, _groups;
};

} // namespace

bool CXDVaultraConduit::isTrusted(const UserName& user, const Dictionary& state) {
    const bool isOwn = user == kSelf;
    _leftAlone.erase(user);
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    const Dictionary* known = users[user.str()].dictionaryIf();
    if (!known) return true;
    Dictionary prior = *known;
    if (isOwn && _takesIn) return takesIn(prior, state);
    const Value knownSerial = prior[kSerialNumber], serial = state[kSerialNumber];
    const bool isAnother = serial.isString() && knownSerial.isString() && knownSerial != serial;
    if (isOwn && !(_isOneOfSeveral && isAnother) && !isMended(prior, state)) return false;
    if (!serial.isString() || isAnother) return true; // no tree, or another one
    const IsHere isHere = [&](const UniqueId& name) {
        return _with.rolvane.recordForUniqueId(nameInDatabase(user, name)) != nullptr;
    };
    const TreeCondition condition = treeCondition(prior, state, isOwn ? _lastSyncDate : std::nullopt, isHere);
    const Value looked = prior[kLookAgain];
    prior.remove(kLookAgain);
    if (condition.isSound()) {
        if (isOwn && !keepsInStepWithOthers(prior, state)) return false;
        prior.set(kTreeDates, state[kTreeDates].dictionary());
        _read.emplace(user, state);
        if (isOwn) mendOwnTree(prior, state);
        return true;
    }
    CXLog("The tree of %@ %@. %@", isOwn ? *realUserFromUser(user) : user, condition.sentence,
          isOwn ? condition.kind == TreeCondition::Kind::lostAGroup ? "That alone is written again."
                                                                    : "It is published again."
                : "It is left alone until its owner has mended it.");
    if (condition.kind == TreeCondition::Kind::setBack) prior.set(kTreeDates, datesToWaitFor(state));
    if (!isOwn) {
        _leftAlone.insert(user);
        return false;
    }
    const bool isGroup = condition.kind == TreeCondition::Kind::lostAGroup;
    const bool mayNeverHaveBeenThere = isGroup || condition.kind == TreeCondition::Kind::lostContacts;
    // It could not be written yet, or waits for a lock.
    if (mayNeverHaveBeenThere && engine().hasPendingChanges(kSelf, conduitSource())) return false;
    if (condition.mayPass() && !looked)
        prior.set(kLookAgain, true);
    else if (isGroup)
        writeAgain(groupsThatAreLost(prior, state, isHere), prior);
    else
        publishAgain(condition, state);
    engine().bringSourcesUpToDate(); // after this pass
    return false;
}

// Halves and leftovers in the own tree are taken away when their time is over.
bool CXDVaultraConduit::isBeingMended() {
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    const Dictionary prior = users[kSelf.str()].dictionary();
    return prior.contains(kNamesAlone) || prior.contains(kUnlistedContacts);
}

// None where nobody can tell, or something is to be done to the tree whatever lies there.
std::optional<CXDVaultraConduit::Comparison> CXDVaultraConduit::comparisonWith(const UserName& user, const Url& base,
                                                                               bool ask) {
    const auto states = engine().stateGeneration();
    if (!states || !_with.rolvane.reached().empty() ||
        (user == kSelf && (isBeingMended() || !engine().conduitObjectForKey(kConduitCX, kPublishAgain).empty())))
        return std::nullopt;
    const auto tree = _with.manager.markOfTree(base, ask);
    return tree ? std::optional(Comparison{_with.rolvane.journalPosition(), *states, *tree, {}}) : std::nullopt;
}

std::optional<Dictionary> CXDVaultraConduit::contactsChangedAlone(const UserName& user, const Url& base) {
    const auto before = _moments.find(user);
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    const Dictionary* known = users[user.str()].dictionaryIf();
    if (before == _moments.end() || !known || known->contains(kAllIsNew) || _leftAlone.contains(user))
        return std::nullopt;
    if (user == kSelf && (_takesIn || (_isOneOfSeveral && isToTellAgain((*known)[kSerialNumber])))) return std::nullopt;
    const auto now = comparisonWith(user, base, true);
    if (!now || now->states != before->second.states ||
        !areEditsOfPeopleAlone(_with.rolvane, before->second.journal, now->journal))
        return std::nullopt;
    std::optional<Dictionary> contacts = contactsChangedSince(user, base, before->second);
    if (!contacts) return std::nullopt;
    Dictionary prior = *known;
    Dictionary dates;
    for (const auto& [file, date] : _with.manager.datesOfTree(base)) dates.set(file, date);
    if (!treeCondition({{kTreeDates, prior[kTreeDates].dictionary()}}, {{kTreeDates, dates}},
                       user == kSelf ? _lastSyncDate : std::nullopt)
             .isSound())
        return std::nullopt;
    prior.set(kTreeDates, dates);
    _compared.insert(*before);
    _lookedAt.insert_or_assign(user, *now);
    return contacts;
}

// Contacts that the database does not have are a matter of the lists that name them.
std::optional<Dictionary> CXDVaultraConduit::contactsChangedSince(const UserName& user, const Url& base,
                                                                  const Comparison& before) {
    std::vector<Url> found;
    for (const UniqueId& contact : before.found) found.push_back(layout::contactLocation(base, contact));
    const auto files = _with.manager.contactsChangedSince(base, before.tree, found);
    if (!files) return std::nullopt;
    Dictionary contacts;
    for (const auto& [path, file] : *files) {
        const UniqueId name(file.displayName);
        if (!name.endsWith(kCXPersonTable) || !layout::isASoundName(name.str()) || !file.modificationdate ||
            file.size > layout::kLargestFile || !_with.rolvane.recordForUniqueId(nameInDatabase(user, name)))
            return std::nullopt;
        contacts.set(name.str(), Dictionary{{kModificationDate, *file.modificationdate}});
    }
    return contacts;
}

// `journal`: as it was when the trees were read.
void CXDVaultraConduit::noteCompared(int64_t journal, const std::map<UserName, Found>& found) {
    constexpr size_t kFew = 100;
    const Found nothing;
    for (const auto& [user, state] : _read) {
        const auto in = found.find(user);
        const Found& here = in == found.end() ? nothing : in->second;
        // The next look begins here, and looks at the contacts that were found once more. Other changes leave no
        // such moment: a pass that takes them in has other states behind it.
        const bool mayBeBegunFrom = here.isContactsAlone && here.contacts.size() <= (user == kSelf ? 0 : kFew);
        if (!mayBeBegunFrom) continue;
        if (const auto base = baseLocationForUser(realUserFromUser(user)))
            if (const auto compared = comparisonWith(user, *base, false))
                _compared.emplace(user, Comparison{journal, compared->states, compared->tree, here.contacts});
    }
    // Where a contact was found, the next look begins at the same moment, and finds whether it was taken in.
    for (auto& [user, now] : std::exchange(_lookedAt, {}))
        if (!found.contains(user)) _compared.insert_or_assign(user, Comparison{journal, now.states, now.tree, {}});
    _moments = std::exchange(_compared, {});
}

// Single files that are too many or too few: another writer has deleted what somebody else was about to write, or the
// store has lost them.
void CXDVaultraConduit::mendOwnTree(const Dictionary& prior, const Dictionary& state) {
    if (_isWrittenByOthers) takeUnlistedAway(prior, state);
    if (!allGroupHas(kCXRemoteLocationProperty)) return; // the list may be older than the withdrawal
    if (_isWrittenByOthers) takeNamesAloneOut(prior, state);
    size_t written = 0;
    for (const UniqueId& name : contactsThatAreMissing(state)) {
        const CXRecordRef person = _with.rolvane.recordForUniqueId(cxUIDWithTableName(name, kCXPersonTable));
        if (!person) continue;
        auto update = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, CXDUpdateRecord, kSelf, person->uniqueId(),
                                                        std::nullopt, person->dictionaryRepresentation());
        update->setAppliesToSources(CXDSyncSourceVaultra);
        _leftovers.push_back(std::move(update));
        ++written;
    }
    if (written > 0) CXLog("The store has lost the files of %@ contacts, which are written again.", written);
}

// Contacts that no list names. One that the list has named until now has been deleted by somebody, and goes at once.
// The writer of another one may still list it, so it is given its time.
void CXDVaultraConduit::takeUnlistedAway(Dictionary prior, const Dictionary& state) {
    _leftovers = removalOfUnlisted(prior, state);
    const Date now = _with.clock.now();
    Dictionary noted = prior[kUnlistedContacts].dictionary().mutableCopy();
    for (const CXDChangeRecordPtr& removal : _leftovers)
        if (removal->type() == CXDDeleteRecord) noted.set(removal->person()->str(), now.addingSeconds(-kPatience));
    std::vector<UniqueId> known;
    for (const std::string& name : noted.allKeys()) known.emplace_back(name);
    Dictionary still;
    for (const UniqueId& name : contactsThatAreUnlisted(state, known)) {
        if (_with.rolvane.recordForUniqueId(cxUIDWithTableName(name, kCXPersonTable))) continue; // to be listed
        const Date since = noted[name.str()].date().value_or(now);
        still.set(name.str(), since);
        if (now.secondsSince(since) < kPatience) continue;
        _foundAgain.insert(name);
        const bool goesAlready = std::any_of(_leftovers.begin(), _leftovers.end(),
                                             [&](const CXDChangeRecordPtr& each) { return each->person() == name; });
        if (!goesAlready) _leftovers.push_back(removalOfContact(name));
    }
    if (still.empty())
        prior.remove(kUnlistedContacts);
    else
        prior.set(kUnlistedContacts, still);
}

// Groups that name a contact or a group which is nowhere, or a group that the owner's database cannot take in.
void CXDVaultraConduit::takeNamesAloneOut(Dictionary prior, const Dictionary& state) {
    const Dictionary alone = namesAlone(
        prior, state, [&](const UniqueId& name) { return _with.rolvane.recordForUniqueId(name) != nullptr; });
    const Dictionary circles = closingCircles(state, [&](const UniqueId& name) {
        std::vector<UniqueId> inner;
        if (const auto group = std::dynamic_pointer_cast<CXGroup>(_with.rolvane.recordForUniqueId(name)))
            inner = group->subgroupUniqueIds();
        for (UniqueId& each : inner) each = cxUIDWithTableName(each, kCXGroupTable);
        return inner;
    });
    const Date now = _with.clock.now();
    const CXDChangeRecords removals = removalOfNamesAlone(prior, alone, circles, now);
    _leftovers.insert(_leftovers.end(), removals.begin(), removals.end());
    const Dictionary before = prior[kNamesAlone].dictionary();
    if (const Dictionary all = namesTogether(before, alone, circles, now); all.empty())
        prior.remove(kNamesAlone);
    else
        prior.set(kNamesAlone, all);
}

// True when nothing had to be mended, or has been long since. When the last of it is on the store: where nobody but the
// owner may write, what is there beside it comes from an older copy, and goes.
bool CXDVaultraConduit::isMended(const Dictionary& prior, const Dictionary& state) {
    const Dictionary again = engine().conduitObjectForKey(kConduitCX, kPublishAgain);
    if (again.empty()) return true;
    // In the pass whose scan takes everything for new no list is known to be written yet.
    const bool isBegun = !_isOneOfSeveral || prior.contains(std::string(layout::kAllGroup));
    if (!isBegun || isToBePublishedAgain()) return false;
    engine().setConduitObjectForKey(kConduitCX, Dictionary(), kPublishAgain);
    if (somebodyMayWrite()) return true;
    _leftovers = removalOfLeftovers(prior, state);
    return _leftovers.empty();
}

bool CXDVaultraConduit::somebodyMayWrite() {
    return _isOneOfSeveral || allGroupHas(kCXReadWriteSharingACLProperty);
}

// Empty lists stay where somebody was or something stood once.
bool CXDVaultraConduit::allGroupHas(const char* property) {
    const auto entries = _with.rolvane.allGroup()->multiValueForProperty(property);
    return entries && !entries->empty();
}

CXDChangeRecords CXDVaultraConduit::changeRecords() {
    const int64_t journal = _with.rolvane.journalPosition(); // of before: what is saved meanwhile counts as unseen
    if (_takesIn) beginTakingIn(engine(), _with.rolvane);
    CXDChangeRecords records = CXDConduit::changeRecords();
    if (_with.rolvane.allGroup()->valueForProperty(kCXRemoteLocationProperty) && endedPublication(_with.preferences))
        _with.preferences.remove(kDaemonDomain, kCXDEndedPublication); // published again since
    readPublishAgain();
    std::map<UserName, Found> found;
    const auto note = [&](const CXDChangeRecords& some) {
        for (const CXDChangeRecordPtr& record : some) {
            if (!record->user()) continue;
            Found& here = found[*record->user()];
            if (record->type() == CXDUpdateRecord && record->person())
                here.contacts.insert(cxNormalizedUID(*record->person()));
            else
                here.isContactsAlone = false;
        }
    };
    note(records);
    leaveUnlistedOut(records);
    forgetWhatHasAFile();
    nameAgain(records);
    compareUnlistedGroups(records);
    compareWhatHadCome(records);
    note(records);
    note(_leftovers);
    noteCompared(journal, found);
    if (const auto own = _read.find(kSelf); _takesIn && own != _read.end())
        _takenIn =
            own->second[kTreeDates].dictionary()[std::string(layout::kDateFile)].date().value_or(Date::distantPast());
    _read.clear();
    records.insert(records.end(), _leftovers.begin(), _leftovers.end());
    _leftovers.clear();
    return records;
}

// Groups that were deleted, here or there, before the list of everybody named them.
void CXDVaultraConduit::compareUnlistedGroups(CXDChangeRecords& records) {
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    AbsenceCheck absences(_with.rolvane);
    for (const auto& [user, state] : _read) {
        const Dictionary prior = users[user.str()].dictionary();
        const auto isHere = [&, &user = user](const UniqueId& group) {
            const UniqueId uid = nameInDatabase(user, group);
            if (_with.rolvane.recordForUniqueId(uid)) return true;
            absences.requireGone(uid);
            return false;
        };
        for (UniqueId& group : unlistedGroupsThatAreGone(prior, state, isHere)) {
            auto removal =
                std::make_shared<CXDChangeRecord>(conduitSource(), CXDDeleteGroup, user, std::nullopt, group);
            removal->setAppliesToSources(CXDSyncSourceCX);
            records.push_back(std::move(removal));
        }
        if (user != kSelf) continue;
        for (CXDChangeRecordPtr& removal : removalOfUnlistedGroups(prior, state, isHere))
            records.push_back(std::move(removal));
    }
}

// New contacts and groups that a killed pass has put there, in lists and all. Those that are nowhere any more have been
// deleted by somebody, and leave the database, too. A leftover that its owner has taken away for want of a name is
// written again. Contacts that came by a group alone leave likewise: the lists of one tree are read one after the
// other, and somebody may write them in between.
void CXDVaultraConduit::compareWhatHadCome(CXDChangeRecords& records) {
    const std::vector<CXReached> reached = whatHadCome();
    _lookedFor.clear();
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    const UniqueId everybody{std::string(layout::kAllGroup)};
    for (const auto& [user, state] : _read) {
        std::vector<UniqueId> names = unlistedContactsThatLeftAGroup(users[user.str()].dictionary(), state);
        std::erase_if(names, [&, &user = user](const UniqueId& name) {
            return !_with.rolvane.recordForUniqueId(nameInDatabase(user, name));
        });
        for (const CXReached& each : reached)
            if (each.tree == user) {
                names.push_back(cxNormalizedUID(each.uniqueId));
                _lookedFor.insert(each.uniqueId);
            }
        if (!mergesInto(user)) continue;
        for (const UniqueId& name : namesThatAreNowhere(state, names)) {
            const auto type = name.endsWith(kCXGroupTable) ? CXDRemoveGroupFromGroup : CXDRemoveRecordFromGroup;
            auto removal = std::make_shared<CXDChangeRecord>(conduitSource(), type, user, name, everybody);
            removal->setAppliesToSources(CXDSyncSourceCX);
            CXDLog("It had come, and was deleted since: %@", removal);
            records.push_back(std::move(removal));
        }
    }
}

// A name may come into the list of everybody before its file. When the file does not follow within a week, the owner's
// daemon takes the name for a leftover and removes it from all lists. Nobody ever had such a record, so it was not
// deleted: its maker's daemon, which still has the file to write, writes the names again.
void CXDVaultraConduit::nameAgain(CXDChangeRecords& records) {
    if (isLeftOut("named again")) return;
    const auto isRemoval = [](const CXDChangeRecord& record) {
        return (record.type() == CXDRemoveRecordFromGroup || record.type() == CXDRemoveGroupFromGroup) &&
               record.user() && record.person() && record.group();
    };
    std::set<std::pair<UserName, UniqueId>> taken;
    for (const CXDChangeRecordPtr& record : records)
        if (isRemoval(*record) && record->group()->str() == layout::kAllGroup &&
            wasNeverThere(*record->user(), *record->person()))
            taken.emplace(*record->user(), *record->person());
    if (taken.empty()) return;
    Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    CXDChangeRecords choices;
    for (CXDChangeRecordPtr& record : records) {
        if (!isRemoval(*record) || !taken.contains({*record->user(), *record->person()})) continue;
        const auto again = [&](CXDChangeType type, const Value& payload = {}) {
            auto change = std::make_shared<CXDChangeRecord>(CXDSyncSourceCX, type, record->user(), record->person(),
                                                            record->group(), payload);
            change->setAppliesToSources(conduitSource());
            return change;
        };
        const bool isGroup = record->type() == CXDRemoveGroupFromGroup;
        Dictionary known = users.dictionaryFor(record->user()->str())
                               .dictionaryFor(cxUIDWithTableName(*record->group(), kCXGroupTable).str());
        known.arrayFor(isGroup ? kSubgroupUIDState : kMemberUIDState).removeAll(*record->person());
        if (const Value& choice = known[kDistributionListState].dictionary()[record->person()->str()])
            choices.push_back(again(CXDUpdateDistributionList, choice));
        CXDLog("It never came to the store, and is named there again: %@", record->description());
        record = again(isGroup ? CXDAddGroupToGroup : CXDAddRecordToGroup);
    }
    records.insert(records.end(), choices.begin(), choices.end());
}

// No file of it is known to have been on the store, and a leftover's time is over for it. The file of a contact comes
// before its name, so a name without a file is noted. A group's comes later, and the states tell of it.
bool CXDVaultraConduit::wasNeverThere(const UserName& user, const UniqueId& name) {
    if (!mergesInto(user)) return false;
    const UniqueId here = nameInDatabase(user, name);
    const CXRecordRef record = _with.rolvane.recordForUniqueId(here);
    if (!record) return false;
    const auto isOver = [&](const Date& since) { return _with.clock.now().secondsSince(since) >= kPatience; };
    if (!name.endsWith(kCXGroupTable)) {
        const std::vector<CXReached> noted = _with.rolvane.reached();
        return std::any_of(noted.begin(), noted.end(), [&](const CXReached& each) {
            return each.uniqueId == here && each.tree == user && !each.hasFile && isOver(each.since);
        });
    }
    const auto made = record->valueForProperty(kCXCreationDateProperty).date();
    if (user == kSelf || !made || !isOver(*made)) return false;
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    return users[user.str()].dictionary()[name.str()].dictionary().empty();
}

// Without those that the states know by now, and those that a leftover's time is over for.
std::vector<CXReached> CXDVaultraConduit::whatHadCome() {
    std::vector<CXReached> reached = _with.rolvane.reached();
    if (reached.empty()) return reached;
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    std::map<UserName, ListedRecords> known;
    std::erase_if(reached, [&](const CXReached& each) {
        return !each.hasFile || _with.clock.now().secondsSince(each.since) >= kPatience ||
               known.try_emplace(each.tree, users[each.tree.str()].dictionary()).first->second.contains(each.uniqueId);
    });
    return reached;
}

void CXDVaultraConduit::forgetWhatIsKnown() {
    const std::vector<CXReached> reached = _with.rolvane.reached();
    if (reached.empty()) return;
    std::unordered_set<UniqueId> unknown;
    for (const CXReached& each : whatHadCome()) unknown.insert(each.uniqueId);
    std::vector<UniqueId> needless;
    for (const CXReached& each : reached)
        if (each.hasFile && !unknown.contains(each.uniqueId)) needless.push_back(each.uniqueId);
    forgetReached(needless);
}

// Names that were noted as without a file, where the trees that were read have one.
void CXDVaultraConduit::forgetWhatHasAFile() {
    if (isLeftOut("files that came")) return;
    std::vector<UniqueId> needless;
    for (const CXReached& each : _with.rolvane.reached())
        if (const auto read = _read.find(each.tree); !each.hasFile && read != _read.end())
            if (read->second[kPeopleState].dictionary()[kMemberUIDState].dictionary().contains(
                    cxNormalizedUID(each.uniqueId).str()))
                needless.push_back(each.uniqueId);
    forgetReached(needless);
}

void CXDVaultraConduit::forgetReached(const std::vector<UniqueId>& records) {
    try {
        _with.rolvane.forgetReached(records);
    } catch (const CXException& exception) {
        CXLog("Notes of new records are kept until the next pass: %@", exception);
    }
}

// A contact that the list of everybody does not name and that joins no group is about to be added, and comes when it is
// listed; or it has been deleted and was written once more by somebody who did not know. Whoever knows it reads what is
// written. Nobody else takes it in: it would stay behind when its file goes. From the own tree it is taken away when
// its time is over.
// (Where single groups are published, the list of everybody does not name all who have joined one since.)
void CXDVaultraConduit::leaveUnlistedOut(CXDChangeRecords& records) {
    std::map<UserName, ListedNames> lists;
    std::set<std::pair<UserName, UniqueId>> joining;
    for (const CXDChangeRecordPtr& record : records)
        if (record->type() == CXDAddRecordToGroup && record->person() && record->user() &&
            _read.contains(*record->user()))
            joining.emplace(*record->user(), *record->person());
    std::erase_if(records, [&](const CXDChangeRecordPtr& record) {
        if (record->type() != CXDUpdateRecord || !record->person() || !record->user()) return false;
        const auto read = _read.find(*record->user());
        if (read == _read.end()) return false;
        if (joining.contains({*record->user(), *record->person()})) return false;
        const UniqueId shared = cxNormalizedUID(*record->person());
        if (lists.try_emplace(*record->user(), read->second, kMemberUIDState).first->second.contains(shared))
            return false;
        if (_with.rolvane.recordForUniqueId(*record->person())) return false;
        CXDLog("Not listed, and left out: %@", record);
        if (record->user() == kSelf && _isWrittenByOthers) noteUnlisted(shared);
        return true;
    });
}

void CXDVaultraConduit::noteUnlisted(const UniqueId& name) {
    const Dictionary users = engine().conduitObjectForKey(kConduitVaultra, kPriorState);
    const Dictionary* prior = users[kSelf.str()].dictionaryIf();
    if (!prior) return;
    Dictionary noted = Dictionary(*prior).dictionaryFor(kUnlistedContacts);
    if (!noted.contains(name.str())) noted.set(name.str(), _with.clock.now());
}

bool CXDVaultraConduit::findsAgain(const CXDChangeRecord& record) const {
    return record.type() == CXDDeleteRecord && record.user() == kSelf && record.person() &&
           _foundAgain.contains(*record.person());
}

// The next scan takes everything for new.
void CXDVaultraConduit::publishAgain(const TreeCondition& condition, const Dictionary& state) {
    Dictionary again = engine().conduitObjectForKey(kConduitCX, kPublishAgain);
    again.set(kSelf.str(), false);
    if (condition.kind == TreeCondition::Kind::setBack) again.set(kOlderCopy, true);
    if (_isOneOfSeveral && !state[std::string(layout::kAllGroup)].dictionary()[kMemberUIDState].isArray())
        again.set(kLostList, listOfAllThatLiesThere(state));
    restoreAccessLists();
}

// The next scan takes these groups for new, and nothing else. A writer who is cut off while deleting a group leaves
// such a tree, too: that group goes again with its name, and nobody whom others have deleted comes back with it.
void CXDVaultraConduit::writeAgain(const std::vector<UniqueId>& groups, Dictionary prior) {
    Dictionary own = engine().conduitObjectForKey(kConduitCX, kPriorState).dictionaryFor(kSelf.str());
    Dictionary unsettled = engine().conduitObjectForKey(kConduitCX, kUnsettledGroups);
    for (const UniqueId& group : groups) {
        prior.remove(group.str());
        own.remove(group.str());
        unsettled.set(cxUIDWithTableName(group, kCXGroupTable).str(), true);
    }
}

void CXDVaultraConduit::readPublishAgain() {
    const Dictionary again = engine().conduitObjectForKey(kConduitCX, kPublishAgain);
    _isOlderCopy = again[kOlderCopy].boolean();
    _lostList = again[kLostList].dictionary();
}

// Until all of it is written, what the owner's tree says is not news, and nobody is told that the owner has been there.
bool CXDVaultraConduit::isToBePublishedAgain() {
    const Dictionary again = engine().conduitObjectForKey(kConduitCX, kPublishAgain);
    if (again.empty()) return false;
    return !again[kSelf.str()].boolean() || engine().hasPendingChanges(kSelf, conduitSource());
}

} // namespace rolvane
