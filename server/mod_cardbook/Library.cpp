#include "server/mod_cardbook/Library.h"

#include "contacts/database/Journal.h"
#include "foundation/PropertyList.h"
#include "server/mod_cardbook/CardText.h"
#include "server/mod_cardbook/CatchUp.h"

#include <cmath>
#include <cstdio>
#include <openssl/evp.h>

namespace rolvane::cardbook {
namespace {

constexpr int kPatienceMilliseconds = 5000;

CXRolvane::Options optionsFor(const std::string& database, DistributedNotifications* told) {
    CXRolvane::Options options;
    options.path = database;
    options.program = std::string(kCXBooksProgram);
    options.distributed = told;
    options.busyTimeoutMilliseconds = kPatienceMilliseconds;
    return options;
}

uint32_t hashOf(std::string_view text) {
    uint32_t hash = 2166136261u; // FNV-1a
    for (const char c : text) hash = (hash ^ static_cast<unsigned char>(c)) * 16777619u;
    return hash;
}

// A book has one colour for ever, in the form that clients exchange.
std::string colorOf(std::string_view id) {
    constexpr const char* kColors[] = {"#3584e4ff", "#33a02cff", "#e66100ff", "#9141acff",
                                       "#c01c28ff", "#986a44ff", "#1b9e77ff", "#5e5c64ff"};
    return kColors[hashOf(id) % std::size(kColors)];
}

// The name that a location gives a book, where its subscription has none: whose it is, where all that somebody shares
// lies in "Contacts", as the own book is called, too; else the name of its place.
std::string nameOfLocation(std::string location) {
    const auto takeLast = [&] {
        while (location.ends_with('/')) location.pop_back();
        const size_t slash = location.rfind('/');
        const std::string last = location.substr(slash + 1);
        location.resize(slash == std::string::npos ? 0 : slash);
        return last;
    };
    const std::string last = takeLast(), owner = takeLast();
    return last == "Contacts" && !owner.empty() ? owner : last;
}

} // namespace

std::string bookMemoryPath(const std::string& database) {
    return database + ".books";
}

Library::Library(const std::string& database, DistributedNotifications* told)
    : _rolvane(optionsFor(database, told)), _memory(bookMemoryPath(_rolvane.path()), kPatienceMilliseconds) {
    _rolvane.keepFormerVersions();
}

void Library::catchUp() {
    cardbook::catchUp(_rolvane, _memory);
}

// Books ------------------------------------------------------------------------------------------------------------

std::optional<Book> Library::groupBook(const UniqueId& uid) {
    const auto group = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(uid));
    if (!group || group->isAllGroup()) return std::nullopt;
    Book book;
    book.kind = Book::Kind::group;
    book.id = std::string(kGroupBook) + std::string(cxUUIDPart(uid));
    book.title = group->name();
    book.description = "The members of the group " + book.title;
    book.group = uid;
    book.color = colorOf(book.id);
    return book;
}

std::optional<Book> Library::sharedBook(const CXSubscriptionRef& subscription) {
    if (!subscription || subscription->isLocal()) return std::nullopt;
    const RemoteLocation location = subscription->remoteLocation();
    if (!_rolvane.allGroupForRemoteLocation(location)) return std::nullopt;
    Book book;
    book.kind = Book::Kind::shared;
    book.id = std::string(kSharedBook) + std::string(cxUUIDPart(subscription->uniqueId()));
    book.title = subscription->name().empty() ? nameOfLocation(location.str()) : subscription->name();
    book.description = "Shared from " + location.str();
    book.isWritable = subscription->isWritable();
    book.location = location;
    book.color = colorOf(book.id);
    return book;
}

std::vector<Book> Library::books() {
    std::vector<Book> all = {*book(std::string(kContactsBook))};
    for (const CXListing& line : _rolvane.listGroups(RemoteLocation("")))
        if (auto group = groupBook(line.uniqueId)) all.push_back(std::move(*group));
    for (const CXSubscriptionRef& subscription : _rolvane.subscriptions())
        if (auto shared = sharedBook(subscription)) all.push_back(std::move(*shared));
    return all;
}

std::optional<Book> Library::book(const std::string& id) {
    if (id == kContactsBook) {
        Book book;
        book.id = id;
        book.title = "Contacts";
        book.description = "Your own contacts and groups";
        book.color = colorOf(id);
        return book;
    }
    if (id.starts_with(kGroupBook))
        return groupBook(UniqueId(id.substr(kGroupBook.size()) + ":" + std::string(kCXGroupTable)));
    if (!id.starts_with(kSharedBook)) return std::nullopt;
    const UniqueId uid(id.substr(kSharedBook.size()) + ":" + std::string(kCXSubscriptionTable));
    return sharedBook(std::dynamic_pointer_cast<CXSubscription>(_rolvane.recordForUniqueId(uid)));
}

// Cards ------------------------------------------------------------------------------------------------------------

std::string Library::tagOf(const UniqueId& uid, Date modified) {
    char text[64];
    std::snprintf(text, sizeof text, "\"%d-%llx-%x\"", kCardTextEdition,
                  static_cast<unsigned long long>(std::llround(modified.secondsSince1970() * 1e6)),
                  static_cast<unsigned>(hashOf(uid.str())));
    return text;
}

Bytes Library::digestOf(const Bytes& properties) {
    Bytes digest(EVP_MAX_MD_SIZE);
    unsigned int length = 0;
    EVP_Digest(properties.data(), properties.size(), digest.data(), &length, EVP_sha256(), nullptr);
    digest.resize(length);
    return digest;
}

Card Library::withText(const Member& member, Date modified, const Bytes& encoded, std::optional<VCardVersion> version,
                       bool anyVersion) {
    Card card{member, modified, tagOf(member.uid, modified), {}};
    if (!version) return card;
    if (_memory.hasWritten(member.uid)) {
        auto own = _memory.written(member.uid, digestOf(encoded));
        if (own && (anyVersion || own->isVersion4 == (*version == VCardVersion::v4))) {
            card.text = std::move(own->text);
            return card;
        }
    }
    card.text = personText(member.uid, BinaryValue::decode(encoded).dictionary(), *version);
    return card;
}

std::optional<Card> Library::groupCard(const Member& member, std::optional<VCardVersion> version, bool anyVersion) {
    const auto group = std::dynamic_pointer_cast<CXGroup>(_rolvane.recordForUniqueId(member.uid));
    const auto modified = group ? group->valueForProperty(kCXModificationDateProperty).date() : std::nullopt;
    if (!modified) return std::nullopt;
    Card card{member, *modified, tagOf(member.uid, *modified), {}};
    if (!version) return card;
    const VCardEntity entity = groupEntity(_rolvane, *group);
    if (_memory.hasWritten(member.uid)) {
        auto own = _memory.written(member.uid, digestOf(groupDigestText(entity)));
        if (own && (anyVersion || own->isVersion4 == (*version == VCardVersion::v4))) {
            card.text = std::move(own->text);
            return card;
        }
    }
    card.text = vcardText(entity, *version);
    return card;
}

void Library::forEachCard(const std::vector<Member>& members, std::optional<VCardVersion> version,
                          const EachCard& call) {
    std::vector<UniqueId> people;
    for (const Member& member : members)
        if (!cxTableName(member.uid).ends_with("Group")) people.push_back(member.uid);
    size_t at = 0; // of `members`: rows come in their order, without those that are gone
    const auto others = [&](const UniqueId* until) {
        for (; at < members.size() && (!until || members[at].uid != *until); ++at) {
            const bool isGroup = cxTableName(members[at].uid).ends_with("Group");
            const auto card = isGroup ? groupCard(members[at], version, false) : std::nullopt;
            call(members[at], card ? &*card : nullptr);
        }
    };
    _rolvane.forEachOf(people, [&](const CXRow& row) {
        others(&row.uniqueId);
        const Card card = withText(members[at], row.modified, *row.encoded, version, false);
        call(members[at++], &card);
    });
    others(nullptr);
}

std::optional<Card> Library::card(const Member& member, std::optional<VCardVersion> version) {
    const bool anyVersion = !version;
    const VCardVersion written = version.value_or(VCardVersion::v3);
    if (cxTableName(member.uid).ends_with("Group")) return groupCard(member, written, anyVersion);
    const std::optional<CXRow> row = _rolvane.personRow(member.uid);
    if (!row) return std::nullopt;
    return withText(member, row->modified, *row->encoded, written, anyVersion);
}

} // namespace rolvane::cardbook
