#include "server/mod_cardbook/CardWriter.h"

#include "contacts/database/History.h"
#include "contacts/database/Journal.h"
#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardReader.h"
#include "contacts/vcard/VCardText.h"
#include "foundation/PropertyList.h"
#include "server/mod_cardbook/CardMerge.h"
#include "server/mod_cardbook/CardText.h"
#include "server/mod_cardbook/Refused.h"
#include "server/mod_cardbook/XmlText.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

namespace rolvane::cardbook {
namespace {

constexpr int kRounds = 100; // against other programs that save the same card in the same moment

Refused changedMeanwhile() {
    return {412, "The card has changed meanwhile."};
}

CXException savedAgainAndAgain() {
    return {kCXDatabaseException, "Other programs kept it locked by saving the same card again and again."};
}

Refused notHere(const std::string& words) {
    return {403, kCardSpace, "addressbook-collection-location-ok", words};
}

bool isGroupRecord(const UniqueId& uid) {
    return cxTableName(uid).ends_with("Group");
}

} // namespace

// Writers take turns, so that a name or a UID that one of them has found free still is when it saves.
class CardWriter::Turn {
public:
    explicit Turn(const std::string& path) : _file(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600)) {
        int locked = -1;
        while (_file >= 0 && (locked = ::flock(_file, LOCK_EX)) != 0 && errno == EINTR) continue;
        if (locked != 0) throw CXException(kCXDatabaseException, "Could not lock " + path + ".");
    }
    ~Turn() {
        if (_file >= 0) ::close(_file);
    }
    Turn(const Turn&) = delete;
    Turn& operator=(const Turn&) = delete;

private:
    int _file;
};

CardWriter::CardWriter(Library& library, WriteContext context)
    : _library(library), _rolvane(library.rolvane()), _memory(library.memory()), _c(std::move(context)) {}

// The card of the name now, for which the conditions hold, in the book as it is now: a subscription may have ended
// since the request began, or the right to write.
std::optional<Member> CardWriter::settle() {
    _library.catchUp();
    auto book = _library.book(_c.book.id);
    if (!book) throw Refused(404, "There is no such book any more.");
    _c.book = std::move(*book);
    requireWritable(_c.book);
    const auto now = _memory.named(_c.book.id, _c.name);
    const bool isSame = now && _c.judged && now->uid == _c.judged->uid && now->modified == _c.judged->modified;
    const bool isNeither = !now && !_c.judged;
    if (!isSame && !isNeither && !_c.conditions.holdAgain(now.has_value())) throw changedMeanwhile();
    return now;
}

void CardWriter::requireWritable(const Book& book) const {
    if (book.isWritable) return;
    const std::string path = escapedPath(pathOf(_c.base, {Place::Kind::book, book.id, {}}));
    throw Refused(403, kDavSpace, "need-privileges", "Whoever shares these contacts does not let you write.",
                  "<D:resource><D:href>" + xmlText(path) +
                      "</D:href><D:privilege><D:write/></D:privilege></D:resource>");
}

// The card that somebody else has taken out of the book, and that the device, not knowing, would bring back: where one
// deletes and the other edits, the deletion stands. A device that has been told of it by an answer to its own question
// may write the card anew. A refusal tells nothing yet: programs repeat what has failed without looking.
std::optional<Member> CardWriter::toBeBroughtBack(const ClientCard& card) {
    auto left = _memory.departed(_c.book.id, _c.name);
    if (!left || vcardMemberKey(cxUUIDPart(left->uid)) != vcardMemberKey(card.entity.uid)) return std::nullopt;
    if (!Devices(_memory).isUnawareOf(_c.device, _c.book.id, *left)) return std::nullopt;
    return left;
}

// People who have left a group are edited in "Contacts" from now on. False: there is no such person any more.
bool CardWriter::goToContacts(const Member& departed) {
    const auto own = _memory.of(kContactsBook, departed.uid);
    if (!own) return false;
    _c.book = *_library.book(std::string(kContactsBook));
    _c.name = own->name;
    _c.judged = own;
    return true;
}

void CardWriter::noteTakenOut() {
    if (const auto left = _memory.departed(_c.book.id, _c.name))
        Devices(_memory).noteTold(_c.device, _c.book.id, *left);
}

// A card that is saved into a subscription which ends at that moment would never be removed. One for a group that is
// deleted then would stay as somebody of no group.
std::vector<CXExpected> CardWriter::expectedOfBook() {
    CXRecordRef of;
    if (_c.book.kind == Book::Kind::shared)
        of = _rolvane.findSubscriptionWithRemoteLocation(_c.book.location);
    else if (_c.book.kind == Book::Kind::group)
        of = groupOf(_c.book);
    else
        return {};
    if (!of) throw Refused(404, "There is no such book any more.");
    return {{of->uniqueId(), of->valueForProperty(kCXModificationDateProperty).date()}};
}

void CardWriter::wish(const Book& book, const UniqueId& uid, const std::string& name) {
    BookMemory::Change change(_memory);
    _memory.wish(book.id, uid, name);
    change.commit();
}

bool CardWriter::saveIfStill(const std::vector<CXExpected>& expected) {
    bool isSaved = false;
    try {
        isSaved = _rolvane.saveIfStill(expected);
    } catch (const std::exception&) {
        _rolvane.rollback();
        throw;
    }
    if (!isSaved) _rolvane.rollback();
    _library.catchUp();
    return isSaved;
}

// The date that the save since then gave the record: another program may have saved it again before the memory took
// that in. A record that the save did not touch has the date that it had.
Date CardWriter::dateOfSave(const CXExpected& before, int64_t since) {
    constexpr size_t kLines = 1000;
    Date date = before.modified.value_or(Date());
    for (const CXJournalEntry& line : _rolvane.journalEntries(since, kLines)) {
        const bool isOwn = line.processID == getpid() && line.program == kCXBooksProgram;
        if (isOwn && cxUUIDPart(line.uniqueId) == cxUUIDPart(before.uniqueId)) date = line.date;
    }
    return date;
}

// Finding ----------------------------------------------------------------------------------------------------------

// References to a UUID may be spelt in the other letter case than the record.
std::vector<UniqueId> CardWriter::spellingsOf(const std::string& uid, std::string_view table) {
    const std::string uuid = vcardUUIDForUID(uid);
    std::vector<UniqueId> all;
    for (const std::string& spelling : {uuid, vcardUpper(uuid), vcardLower(uuid)})
        all.emplace_back(spelling + ":" + std::string(table));
    return all;
}

CXRecordRef CardWriter::recordOf(const std::string& uid, std::string_view table) {
    for (const UniqueId& spelling : spellingsOf(uid, table))
        if (auto record = _rolvane.recordForUniqueId(spelling)) return record;
    return nullptr;
}

void CardWriter::conflict(const Member& other, const std::string& book) {
    const std::string path =
        escapedPath(pathOf(_c.base, {Place::Kind::card, book.empty() ? _c.book.id : book, other.name}));
    throw Refused(409, kCardSpace, "no-uid-conflict", "Another card has this UID, or this card has another one.",
                  "<D:href>" + xmlText(path) + "</D:href>");
}

// The record that the card is about; null for a new one.
CXRecordRef CardWriter::target(const ClientCard& card, const std::optional<Member>& now) {
    const bool isShared = _c.book.kind == Book::Kind::shared;
    const CXRecordRef person = recordOf(card.entity.uid, isShared ? kCXSubscribedPersonTable : kCXPersonTable);
    const CXRecordRef group = recordOf(card.entity.uid, isShared ? kCXSubscribedGroupTable : kCXGroupTable);
    const CXRecordRef found = person ? person : group;
    if (now && (!found || found->uniqueId() != now->uid)) conflict(*now);
    if (!found) {
        // A person who was joined with another one lives on in that one's card.
        const auto joined = card.entity.isGroup ? std::nullopt : _memory.joinedAs(vcardMemberKey(card.entity.uid));
        if (joined && isShared == cxIsSubscribed(*joined) && _rolvane.recordForUniqueId(*joined))
            conflict(_memory.of(_c.book.id, *joined).value_or(Member{*joined, _c.name, {}}));
        return nullptr;
    }
    if (const auto here = now ? std::nullopt : _memory.of(_c.book.id, found->uniqueId())) conflict(*here);
    if ((found == group) != card.entity.isGroup) conflict(now ? *now : Member{found->uniqueId(), _c.name, {}});
    if (isShared && !now) conflict({found->uniqueId(), _c.name, {}}); // in another of the shared books
    return found;
}

CXGroupRef CardWriter::groupOf(const Book& book) {
    auto group = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(book.group));
    if (!group) throw Refused(404, "The group has gone.");
    return group;
}

// Writing ----------------------------------------------------------------------------------------------------------

Written CardWriter::put(const std::string& text) {
    requireWritable(_c.book);
    const ClientCard card = readClientCard(text, Bounds::ofClients);
    if (!isUsableName(_c.name)) throw notHere("A card cannot be called so.");
    if (card.entity.isGroup && _c.book.kind != Book::Kind::contacts)
        throw notHere("Cards of groups are written in \"Contacts\".");
    if (!Devices(_memory).mayLearn(_c.device, knowledgeOf(card)))
        throw Refused(403, kCardSpace, "valid-address-data", "This device has written too many kinds of properties.");
    const Turn turn(bookMemoryPath(_rolvane.path()) + ".lock");
    bool isElsewhere = false; // the card's person has left the book
    for (int round = 0; round < kRounds; ++round) {
        const auto now = settle();
        if (const auto left = now || _c.conditions.isAbsent ? std::nullopt : toBeBroughtBack(card)) {
            if (!_c.repeatsRefused) throw Refused(412, "Somebody else has taken the card out of the book meanwhile.");
            // The program would never look into the book again. So its next look tells it.
            isElsewhere = true;
            if (!goToContacts(*left)) return {};
            continue;
        }
        const auto written = card.entity.isGroup ? putGroup(card, now) : putPerson(card, now);
        if (!written) continue;
        Devices(_memory).noteKnowledge(_c.device, knowledgeOf(card));
        return isElsewhere ? Written{} : *written;
    }
    throw savedAgainAndAgain();
}

// The version that the client wrote over, as far as it is known.
std::optional<Dictionary> CardWriter::hadBy(const std::optional<Member>& now, const Dictionary& properties) {
    if (!now) return std::nullopt; // by another name, or in another book: nothing is known to be common
    if (_c.conditions.namesTag) return properties;
    const Devices::Had had = Devices(_memory).had(_c.device, _c.book.id, *now);
    if (had.isPresent) return properties;
    const auto former = had.then ? _rolvane.formerVersion(now->uid, *had.then) : nullptr;
    if (!former) return std::nullopt;
    return BinaryValue::decode(*former).dictionary();
}

void CardWriter::apply(const CXPersonRef& person, const Dictionary& before, const Dictionary& after) {
    for (const auto& [name, value] : after)
        if (before[name] != value) person->setValue(value, name);
    for (const auto& [name, value] : before)
        if (!after.contains(name)) person->removeValueForProperty(name);
}

std::optional<Written> CardWriter::putPerson(const ClientCard& card, const std::optional<Member>& now) {
    const std::vector<CXExpected> ofBook = expectedOfBook(); // before a change of this request gives it another date
    auto person = std::dynamic_pointer_cast<CXPerson>(target(card, now));
    const bool isShared = _c.book.kind == Book::Kind::shared;
    std::vector<CXExpected> expected;
    if (person) {
        const Dictionary before = person->dictionaryRepresentation();
        expected.push_back({person->uniqueId(), person->valueForProperty(kCXModificationDateProperty).date()});
        // Another program has saved since the memory was brought up to date: the client has not had what it saved.
        if (now && expected.back().modified != now->modified) return std::nullopt;
        Devices devices(_memory);
        const auto merge = mergedCard(person->uniqueId(), hadBy(now, before), before, card,
                                      [&](const std::string& property) { return devices.knows(_c.device, property); });
        apply(person, before, merge.contact);
        if (!merge.conflicts.empty()) _rolvane.noteConflicts(person->uniqueId(), merge.conflicts);
    } else {
        const std::string table(isShared ? kCXSubscribedPersonTable : kCXPersonTable);
        person = CXPerson::initWithUniqueId(UniqueId(vcardUUIDForUID(card.entity.uid) + ":" + table));
        person->resetWithDictionary(card.entity.properties, true, false);
        if (isShared) {
            CXMutableMultiValue where;
            where.addValue(_c.book.location.str(), kCXSubscribeLabel);
            person->setValue(where, kCXRemoteLocationProperty);
        }
        _rolvane.addRecord(person);
        expected.push_back({person->uniqueId(), std::nullopt});
        if (!isShared) joinGroupsThatWaitFor(person, card.entity.uid);
    }
    expected.insert(expected.end(), ofBook.begin(), ofBook.end());
    if (_c.book.kind == Book::Kind::group) groupOf(_c.book)->addMember(person);
    const UniqueId uid = person->uniqueId();
    const auto encoded = person->encodedRepresentation();
    const bool isWhole = saysTheSame(uid, BinaryValue::decode(*encoded).dictionary(), card);
    const Bytes digest = Library::digestOf(*encoded);
    {
        BookMemory::Change change(_memory);
        if (!now) _memory.wish(_c.book.id, uid, _c.name);
        if (!now && !isShared && !_memory.of(kContactsBook, uid)) _memory.wish(kContactsBook, uid, _c.name);
        if (isWhole) _memory.setWritten(uid, digest, {card.text, card.isVersion4});
        change.commit();
    }
    const int64_t since = _rolvane.journalPosition();
    if (!saveIfStill(expected)) return std::nullopt;
    if (!_memory.of(_c.book.id, uid)) throw Refused(409, "The card has left the book at the same moment.");
    const Date date = dateOfSave(expected.front(), since);
    {
        BookMemory::Change change(_memory);
        _memory.keepWrittenOnly(uid, digest);
        change.commit();
    }
    if (isWhole) Devices(_memory).noteHad(_c.device, {{uid, date}}); // else it has to read what it was merged with
    return Written{isWhole ? Library::tagOf(uid, date) : "", !now};
}

std::optional<Written> CardWriter::putGroup(const ClientCard& card, const std::optional<Member>& now) {
    auto group = std::dynamic_pointer_cast<CXGroup>(target(card, now));
    std::vector<CXExpected> expected;
    VCardEntity before;
    Dictionary stored;
    std::optional<Dictionary> had;
    Devices::Had listed; // the lists that the client had
    if (group) {
        stored = group->dictionaryRepresentation();
        before = groupEntity(_rolvane, *group);
        expected.push_back({group->uniqueId(), group->valueForProperty(kCXModificationDateProperty).date()});
        if (now && expected.back().modified != now->modified) return std::nullopt; // as of a person
        had = hadBy(now, stored);
        if (now) listed = Devices(_memory).had(_c.device, _c.book.id, *now);
        listed.isPresent |= _c.conditions.namesTag;
    } else {
        group =
            CXGroup::initWithUniqueId(UniqueId(vcardUUIDForUID(card.entity.uid) + ":" + std::string(kCXGroupTable)));
        group->resetWithDictionary(card.entity.properties, true, false);
        _rolvane.addRecord(group);
        expected.push_back({group->uniqueId(), std::nullopt});
        joinGroupsThatWaitFor(group, card.entity.uid);
    }
    for (const auto& [name, value] : card.entity.properties) {
        const bool isTheClients = !had || (*had)[name] != value; // else it is as the client found it
        if (isTheClients && group->valueForProperty(name) != value) group->setValue(value, name);
    }
    setMembers(group, card, before, vcardKeptLines(stored, kVCardMissingMemberLine), listed);
    const UniqueId uid = group->uniqueId();
    const VCardEntity after = groupEntity(_rolvane, *group);
    const bool isWhole = card.isWhole && after.members == card.entity.members &&
                         after.subgroups == card.entity.subgroups && after.properties == card.entity.properties;
    const Bytes digest = Library::digestOf(groupDigestText(after));
    {
        BookMemory::Change change(_memory);
        if (!now) _memory.wish(_c.book.id, uid, _c.name);
        if (isWhole) _memory.setWritten(uid, digest, {card.text, card.isVersion4});
        change.commit();
    }
    const int64_t since = _rolvane.journalPosition();
    if (!saveIfStill(expected)) return std::nullopt;
    if (!_memory.of(_c.book.id, uid)) throw Refused(409, "The group has left the book at the same moment.");
    const Date date = dateOfSave(expected.front(), since);
    if (isWhole) Devices(_memory).noteHad(_c.device, {{uid, date}}); // else it has to read what it was merged with
    return Written{isWhole ? Library::tagOf(uid, date) : "", !now};
}

// Each member for itself: a change of the client's against the lists that it had is made, and one that somebody else
// has made since stands. Members who have no card here are kept by their UIDs, as the import does. A client that never
// wrote a member does not know of members.
void CardWriter::setMembers(const CXGroupRef& group, const ClientCard& card, const VCardEntity& before,
                            std::vector<VCardLine> missing, const Devices::Had& had) {
    CXHistory history(_rolvane);
    const auto then = !had.isPresent && had.then ? history.lastUntil(*had.then) : std::nullopt;
    const auto wasListed = [&](const UniqueId& record) {
        return had.isPresent || (then && history.wasListed(*then, group->uniqueId(), record, true));
    };
    std::set<std::string> now, said;
    for (const auto* list : {&before.members, &before.subgroups})
        for (const std::string& uid : *list) now.insert(vcardMemberKey(uid));
    const auto hasLeft = [&](const std::string& uid, std::string_view table) {
        if (!then || now.contains(vcardMemberKey(uid))) return false;
        const auto spellings = spellingsOf(uid, table);
        return std::any_of(spellings.begin(), spellings.end(), [&](const UniqueId& record) {
            return history.wasListed(*then, group->uniqueId(), record, false);
        });
    };
    const bool saysMembers = !card.entity.members.empty() || !card.entity.subgroups.empty();
    const bool knowsMembers = saysMembers || Devices(_memory).knows(_c.device, "line:MEMBER");
    if (had.isPresent && knowsMembers) missing.clear();
    std::set<std::string> known; // the values of `missing`
    for (const VCardLine& line : missing) known.insert(line.value);
    for (const auto* list : {&card.entity.members, &card.entity.subgroups})
        for (const std::string& uid : *list) {
            said.insert(vcardMemberKey(uid));
            if (hasLeft(uid, kCXPersonTable) || hasLeft(uid, kCXGroupTable)) continue;
            if (auto person = std::dynamic_pointer_cast<CXPerson>(recordOf(uid, kCXPersonTable))) {
                group->addMember(person);
            } else if (auto subgroup = std::dynamic_pointer_cast<CXGroup>(recordOf(uid, kCXGroupTable))) {
                if (group->mayListSubgroup(subgroup)) group->addSubgroup(subgroup);
            } else {
                VCardLine line;
                line.name = kVCardMissingMemberLine;
                line.value = vcardEscape(uid);
                if (known.insert(line.value).second) missing.push_back(line);
            }
        }
    setMissingMembers(group, missing);
    if (!knowsMembers) return;
    for (const std::string& uid : before.members)
        if (!said.contains(vcardMemberKey(uid)))
            if (auto person = std::dynamic_pointer_cast<CXPerson>(recordOf(uid, kCXPersonTable));
                person && wasListed(person->uniqueId()))
                group->removeMember(person);
    for (const std::string& uid : before.subgroups)
        if (!said.contains(vcardMemberKey(uid)))
            if (auto subgroup = std::dynamic_pointer_cast<CXGroup>(recordOf(uid, kCXGroupTable));
                subgroup && wasListed(subgroup->uniqueId()))
                group->removeSubgroup(subgroup);
}

void CardWriter::setMissingMembers(const CXGroupRef& group, const std::vector<VCardLine>& missing) {
    Dictionary properties = group->dictionaryRepresentation();
    vcardReplaceKeptLines(properties, kVCardMissingMemberLine, missing);
    const Value& extras = properties[kCXVCardExtraProperty];
    if (group->valueForProperty(kCXVCardExtraProperty) != extras) group->setValue(extras, kCXVCardExtraProperty);
}

// Groups whose cards came before this one, and name it, list it from now on.
void CardWriter::joinGroupsThatWaitFor(const CXRecordRef& record, const std::string& uid) {
    for (const UniqueId& waiting : _memory.waitingFor(vcardMemberKey(uid))) {
        const auto group = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(waiting));
        if (!group || waiting == record->uniqueId()) continue;
        auto missing = vcardKeptLines(group->dictionaryRepresentation(), kVCardMissingMemberLine);
        const auto isIt = [&](const VCardLine& each) {
            return vcardMemberKey(vcardUnescape(each.value)) == vcardMemberKey(uid);
        };
        if (std::erase_if(missing, isIt) == 0) continue;
        setMissingMembers(group, missing);
        if (const auto person = std::dynamic_pointer_cast<CXPerson>(record))
            group->addMember(person);
        else if (const auto subgroup = std::dynamic_pointer_cast<CXGroup>(record); group->mayListSubgroup(subgroup))
            group->addSubgroup(subgroup);
    }
}

// Removing and moving ----------------------------------------------------------------------------------------------

void CardWriter::remove() {
    requireWritable(_c.book);
    const Turn turn(bookMemoryPath(_rolvane.path()) + ".lock");
    for (int round = 0; round < kRounds; ++round) {
        const auto now = settle();
        if (!now) throw Refused(404, "The card has gone already.");
        if (_c.book.kind == Book::Kind::shared && isGroupRecord(now->uid))
            throw notHere("Groups of other people stay theirs.");
        if (removeIfStill(*now)) return noteTakenOut();
    }
    throw savedAgainAndAgain();
}

bool CardWriter::removeIfStill(const Member& now) {
    const CXRecordRef record = _rolvane.recordForUniqueId(now.uid);
    if (!record) throw Refused(404, "The card has gone already.");
    if (_c.book.kind == Book::Kind::group)
        groupOf(_c.book)->removeMember(std::dynamic_pointer_cast<CXPerson>(record));
    else
        _rolvane.removeRecord(record);
    const bool isOfAVersion = _c.conditions.namesTag || _c.conditions.hasDate;
    return saveIfStill(isOfAVersion ? std::vector<CXExpected>{{now.uid, now.modified}} : std::vector<CXExpected>{});
}

// The record of the card joins the book of a group.
bool CardWriter::join(const Book& to, const std::string& name, bool mayReplace) {
    const auto now = settle();
    if (!now) throw Refused(404, "The card has gone already.");
    const auto person = std::dynamic_pointer_cast<CXPerson>(_rolvane.recordForUniqueId(now->uid));
    if (!person || person->isSubscribed()) throw notHere("Only people of your own can be in your groups.");
    const auto there = _memory.named(to.id, name);
    if (there && (!mayReplace || there->uid != now->uid)) throw changedMeanwhile();
    const auto here = _memory.of(to.id, now->uid);
    if (here && here->name != name) conflict(*here, to.id);
    if (!here) wish(to, now->uid, name);
    groupOf(to)->addMember(person);
    return !there;
}

bool CardWriter::copy(const Book& to, const std::string& name, bool mayReplace) {
    // There the card would be twice.
    if (const auto card = _memory.named(_c.book.id, _c.name); card && to.kind != Book::Kind::shared)
        if (const auto there = _memory.of(to.id, card->uid); there && (to.id == _c.book.id || there->name != name))
            conflict(*there, to.id);
    if (_c.book.kind == Book::Kind::shared || to.kind != Book::Kind::group)
        throw notHere("A card has one UID, so it is copied from \"Contacts\" or a group into another group only.");
    if (!isUsableName(name)) throw notHere("A card cannot be called so.");
    const Turn turn(bookMemoryPath(_rolvane.path()) + ".lock");
    const bool made = join(to, name, mayReplace);
    save();
    return made;
}

bool CardWriter::move(const Book& to, const std::string& name, bool mayReplace) {
    requireWritable(_c.book);
    if (!isUsableName(name)) throw notHere("A card cannot be called so.");
    const Turn turn(bookMemoryPath(_rolvane.path()) + ".lock");
    if (to.id == _c.book.id) {
        const auto now = settle();
        if (!now) throw Refused(404, "The card has gone already.");
        if (_memory.named(to.id, name)) throw notHere("Another card is called so.");
        BookMemory::Change change(_memory);
        _memory.rename(to.id, *now, name);
        change.commit();
        return true;
    }
    if (_c.book.kind != Book::Kind::group || to.kind == Book::Kind::shared)
        throw notHere("Cards move from group to group, or out of a group to \"Contacts\", where they are.");
    bool made = false;
    if (to.kind == Book::Kind::group) {
        made = join(to, name, mayReplace);
    } else {
        const auto now = settle();
        const auto there = now ? _memory.of(to.id, now->uid) : std::nullopt;
        if (!there || there->name != name) throw notHere("In \"Contacts\" the card has its name already.");
        if (!mayReplace) throw changedMeanwhile();
    }
    const auto now = _memory.named(_c.book.id, _c.name);
    if (now) groupOf(_c.book)->removeMember(std::dynamic_pointer_cast<CXPerson>(_rolvane.recordForUniqueId(now->uid)));
    save();
    noteTakenOut();
    return made;
}

} // namespace rolvane::cardbook
