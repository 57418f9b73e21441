#pragma once

#include "server/mod_cardbook/ClientCard.h"
#include "server/mod_cardbook/Devices.h"
#include "server/mod_cardbook/Library.h"

#include <optional>
#include <string>

namespace rolvane::cardbook {

// The conditions of a request on the card that it changes (RFC 9110 section 13.1). All of it was judged once, before
// the body.
struct Conditions {
    bool namesTag = false; // If-Match names the tag that the card had: the client has had that version
    bool exists = false;   // If-Match: *
    bool isAbsent = false; // If-None-Match: *
    bool hasDate = false;  // If-Unmodified-Since; a second is too coarse to name a version

    // Do they hold for a card that is not the one any more that they were judged against?
    bool holdAgain(bool isThere) const {
        return !namesTag && !hasDate && !(exists && !isThere) && !(isAbsent && isThere);
    }
};

// The device that writes, and the state that the request's conditions were judged against.
struct WriteContext {
    Book book;
    std::string name; // of the card
    std::string base; // of the paths
    std::string device;
    Conditions conditions;
    std::optional<Member> judged; // what they were judged against
    // The program sends what was refused again, and again, before it asks for anything else.
    bool repeatsRefused = false;
};

struct Written {
    std::string tag; // of the card as it stands now; "" where it is not what the client sent
    bool made = false;
};

// Changes the contact database for a client. Throws Refused, with nothing changed. Writers of books wait for each
// other, across processes too. Where another program saves the record meanwhile, the conditions are looked at again
// (412 where they do not hold any more), and the change is made anew against what that program saved. A change that was
// made is in the database when an operation returns, and the memory has taken it in. One thread.
class CardWriter {
public:
    CardWriter(Library& library, WriteContext context);

    Written put(const std::string& text);
    void remove();
    // The card leaves this book (but for "Contacts", which a group's members stay in) and joins the other one, or is
    // called otherwise in the same. True when it is new there.
    bool move(const Book& to, const std::string& name, bool mayReplace);
    bool copy(const Book& to, const std::string& name, bool mayReplace);

private:
    class Turn; // of a writer
    std::optional<Member> settle();
    void requireWritable(const Book& book) const;
    std::optional<Member> toBeBroughtBack(const ClientCard& card);
    bool goToContacts(const Member& departed);
    void noteTakenOut();
    std::vector<CXExpected> expectedOfBook();
    static std::vector<UniqueId> spellingsOf(const std::string& uid, std::string_view table);
    CXRecordRef recordOf(const std::string& uid, std::string_view table);
    [[noreturn]] void conflict(const Member& other, const std::string& book = {}); // in that book, else in this one
    void requireFreeUID(const ClientCard& card, const std::optional<Member>& now);
    CXRecordRef target(const ClientCard& card, const std::optional<Member>& now);
    // Nothing: another program has saved the record meanwhile, and nothing was changed.
    std::optional<Written> putPerson(const ClientCard& card, const std::optional<Member>& now);
    std::optional<Written> putGroup(const ClientCard& card, const std::optional<Member>& now);
    bool removeIfStill(const Member& now);
    std::optional<Dictionary> hadBy(const std::optional<Member>& now, const Dictionary& properties);
    void apply(const CXPersonRef& person, const Dictionary& before, const Dictionary& after);
    void setMembers(const CXGroupRef& group, const ClientCard& card, const VCardEntity& before,
                    std::vector<VCardLine> missing, const Devices::Had& had);
    static void setMissingMembers(const CXGroupRef& group, const std::vector<VCardLine>& missing);
    void joinGroupsThatWaitFor(const CXRecordRef& record, const std::string& uid);
    CXGroupRef groupOf(const Book& book);
    bool join(const Book& to, const std::string& name, bool mayReplace);
    bool saveIfStill(const std::vector<CXExpected>& expected);
    void save() { saveIfStill({}); }
    Date dateOfSave(const CXExpected& before, int64_t since);
    void wish(const Book& book, const UniqueId& uid, const std::string& name);

    Library& _library;
    CXRolvane& _rolvane;
    BookMemory& _memory;
    WriteContext _c;
};

} // namespace rolvane::cardbook
