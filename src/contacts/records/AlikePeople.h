#pragma once

#include "contacts/database/CXRolvane.h"

#include <set>
#include <string>
#include <unordered_map>
#include <vector>

namespace rolvane {

// People who are likely to be one: the same name, and the same mail address or telephone number. Pure but for the
// class.

// The name as it is compared: without letter case, blanks at the ends, or several of them in a row.
std::string cxComparedName(const std::string& displayName);
// What a person can be reached by, as it is compared: mail addresses in small letters, telephone numbers by their last
// nine digits, so that those with and without the country's are equal. Shorter ones than five digits are left out.
std::set<std::string> cxReachedBy(const Dictionary& person);
bool cxShareAny(const std::set<std::string>& a, const std::set<std::string>& b);

// How two people are alike.
enum class CXAlikeness {
    none,
    reached, // the same mail address or number under different names
    named,   // the same name and nothing else in common
    same     // the same name, and a mail address or number in common, or one has everything that the other has
};
CXAlikeness cxAlikeness(const Dictionary& a, const Dictionary& b);

// Finds the person of the owner's own whom a card without UID is about. Borrows the database; one thread.
class CardOwnerFinder {
public:
    explicit CardOwnerFinder(CXRolvane& rolvane) : _rolvane(rolvane) {}

    struct Found {
        CXPersonRef person;   // null: nobody whom the card is surely about
        bool another = false; // there is somebody of that name
    };
    // Who has all that the card has, else the one of its name who has a mail address or a number of it. Of somebody in
    // `inThisImport` no single value may be replaced: two cards of one file are not one because of a number.
    Found find(const Dictionary& card, const std::set<UniqueId>& inThisImport);
    void note(const CXPerson& person); // somebody was added, or has another name now

private:
    void load();

    CXRolvane& _rolvane;
    bool _loaded = false;
    std::unordered_map<std::string, std::vector<UniqueId>> _byName;
};

} // namespace rolvane
