#pragma once

#include "server/mod_cardbook/ClientCard.h"
#include "server/mod_cardbook/Library.h"

#include <optional>
#include <string>

namespace rolvane::cardbook {

// The device that writes, and the state that the request's conditions were judged against.
struct WriteContext {
    const Book& book;
    std::string name; // of the card
    std::string base; // of the paths
    std::string device;
    bool isConditional = false;   // If-Match or If-None-Match was there
    std::optional<Member> judged; // what they were judged against
};

struct Written {
    std::string tag; // of the card as it stands now; "" where it is not what the client sent
    bool made = false;
};

// Changes the contact database for a client. Throws Refused, with nothing changed; conditions are looked at again in
// the transaction. Writers wait for each other, across processes too. A change that was made is in the database when an
// operation returns, and the memory has taken it in. One thread.
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
    CXRecordRef recordOf(const std::string& uid, std::string_view table);
    [[noreturn]] void conflict(const Member& other, const std::string& book = {}); // in that book, else in this one
    void requireFreeUID(const ClientCard& card, const std::optional<Member>& now);
    CXRecordRef target(const ClientCard& card, const std::optional<Member>& now);
    Written putPerson(const ClientCard& card, const std::optional<Member>& now);
    Written putGroup(const ClientCard& card, const std::optional<Member>& now);
    std::optional<Dictionary> hadBy(const std::optional<Member>& now, const Dictionary& properties);
    void apply(const CXPersonRef& person, const Dictionary& before, const Dictionary& after);
    bool setMembers(const CXGroupRef& group, const ClientCard& card, const VCardEntity& before, bool mayRemove);
    CXGroupRef groupOf(const Book& book);
    bool join(const Book& to, const std::string& name, bool mayReplace);
    void save(const std::vector<CXExpected>& expected);
    Date dateOfSave(const CXExpected& before, int64_t since);
    void wish(const Book& book, const UniqueId& uid, const std::string& name);

    Library& _library;
    CXRolvane& _rolvane;
    BookMemory& _memory;
    WriteContext _c;
};

} // namespace rolvane::cardbook
