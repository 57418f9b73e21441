#pragma once

#include "contacts/database/CXRolvane.h"
#include "contacts/vcard/VCardWriter.h"
#include "server/mod_cardbook/BookMemory.h"
#include "server/mod_cardbook/Place.h"

#include <functional>
#include <memory>
#include <string>
#include <vector>

namespace rolvane::cardbook {

// A collection of cards: the owner's own people and groups, the members of one group, or what came by a subscription.
struct Book {
    enum class Kind { contacts, group, shared };
    Kind kind = Kind::contacts;
    std::string id; // the part of its path
    std::string title, description, color;
    bool isWritable = true;
    RemoteLocation location; // of a shared one
    UniqueId group;          // of a group's
};

// A card as it stands now.
struct Card {
    Member member;
    Date modified;
    std::string tag; // with its quotes
    std::string text;
};

// The contact database and what the books remember beside it, as one request sees them. One thread at a time. Errors:
// CXException of the two files.
class Library {
public:
    // The file of the books lies beside the database. Its saves are told to `told`, which must outlive it.
    explicit Library(const std::string& database, DistributedNotifications* told = nullptr);

    CXRolvane& rolvane() { return _rolvane; }
    BookMemory& memory() { return _memory; }

    bool isOfPast() const { return _rolvane.isOfPast() || _memory.isOfPast(); } // a file was replaced
    // Takes in what any program has saved since. What is read afterwards is at least of that moment.
    void catchUp();

    std::vector<Book> books(); // "Contacts", the groups by name, the subscriptions oldest first
    std::optional<Book> book(const std::string& id);

    // The cards of these members, in their order; a member whose record has gone meanwhile has none. Without a version
    // the text stays empty.
    using EachCard = std::function<void(const Member&, const Card*)>;
    void forEachCard(const std::vector<Member>& members, std::optional<VCardVersion> version, const EachCard& call);
    // With the client's own text where it is of the asked version, or of any where none is asked.
    std::optional<Card> card(const Member& member, std::optional<VCardVersion> version);

    static std::string tagOf(const UniqueId& uid, Date modified); // an entity tag, with its quotes
    static Bytes digestOf(const Bytes& properties);

private:
    Card withText(const Member& member, Date modified, const Bytes& encoded, std::optional<VCardVersion> version,
                  bool anyVersion);
    std::optional<Card> groupCard(const Member& member, std::optional<VCardVersion> version, bool anyVersion);
    std::optional<Book> groupBook(const UniqueId& uid);
    std::optional<Book> sharedBook(const CXSubscriptionRef& subscription);

    CXRolvane _rolvane;
    BookMemory _memory;
};

// Where the books of a database remember things.
std::string bookMemoryPath(const std::string& database);

} // namespace rolvane::cardbook
