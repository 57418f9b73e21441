#include "TestDatabase.h"

#include "contacts/records/Constants.h"
#include "contacts/records/SearchText.h"
#include "foundation/Sqlite.h"

#include <fstream>

namespace rolvane::test {
namespace {

std::vector<std::string> names(const std::vector<CXListing>& listings) {
    std::vector<std::string> all;
    for (const CXListing& listing : listings) all.push_back(listing.displayName);
    return all;
}
using Names = std::vector<std::string>;

struct WordSearch : testing::Test {
    TestDatabase d;
    void add(const std::string& first, const std::string& phone, const std::string& note = {},
             const std::string& mail = {}) {
        const CXPersonRef person = d.addPerson(first);
        const auto set = [&](const char* property, const std::string& text) {
            CXMutableMultiValue values;
            values.addValue(text, "home");
            person->setValue(values, property);
        };
        if (!phone.empty()) set(kCXPhoneProperty, phone);
        if (!mail.empty()) set(kCXEmailProperty, mail);
        if (!note.empty()) person->setValue(note, kCXNoteProperty);
    }
    Names found(const std::string& words) { return names(d->peopleFound(CXSearchQuery(words))); }
};

TEST_F(WordSearch, NameMailNoteAndPhoneAreFoundByWords) {
    add("Ada", "+49 (0)170 123 45 67", "met at the Zürich fair", "ada@example.org");
    add("Bob", "0170/7654321");
    d->save();
    EXPECT_EQ(found("ADA"), Names{"Ada"});
    EXPECT_EQ(found("example.org"), Names{"Ada"});
    EXPECT_EQ(found("zurich fair"), Names{"Ada"});
    EXPECT_EQ(found("fair ada"), Names{"Ada"}) << "in any order";
    EXPECT_EQ(found("ada bob"), Names{}) << "one person has them all";
    EXPECT_EQ(found("0170"), (Names{"Bob"})) << "a part of a number is meant as it is written";
    EXPECT_EQ(found("170"), (Names{"Ada", "Bob"}));
    EXPECT_EQ(found(""), Names{});
    EXPECT_EQ(found("  "), Names{});
}

TEST_F(WordSearch, APhoneIsFoundInAnySpelling) {
    add("Ada", "+49 (0)170 123 45 67");
    add("Bob", "0170-1234568");
    d->save();
    for (const char* spelling :
         {"+491701234567", "+49 170 1234567", "0049 170 123 4567", "0170 1234567", "(0170) 123-4567", "1234567",
          "170.123.45.67", "+49 (0)170 1234567", "ada 0170 1234567"})
        EXPECT_EQ(found(spelling), Names{"Ada"}) << spelling;
    EXPECT_EQ(found("+49 170 1234568"), Names{"Bob"}) << "the country's code is not kept here";
    EXPECT_EQ(found("+49 171 1234567"), Names{});
    EXPECT_EQ(found("0170 1234569"), Names{});
}

TEST_F(WordSearch, NumbersOfANoteAreWords) {
    add("Ada", "", "born 1980, 2 children, room 17");
    d->save();
    EXPECT_EQ(found("1980"), Names{"Ada"});
    EXPECT_EQ(found("17 1980"), Names{"Ada"}) << "neighbours are no phone number here";
    EXPECT_EQ(found("1981"), Names{});
}

TEST_F(WordSearch, AccentsAndLetterCaseDoNotMatter) {
    add("Jürgen Groß", "");
    add("Søren Łukasz", "");
    add("Ελένη", "");
    add("Nguyễn", "");
    add("Rene\xCC\x81", ""); // the accent by itself
    d->save();
    EXPECT_EQ(found("jurgen GROSS"), Names{"Jürgen Groß"});
    EXPECT_EQ(found("JÜRGEN groß"), Names{"Jürgen Groß"});
    EXPECT_EQ(found("soren lukasz"), Names{"Søren Łukasz"});
    EXPECT_EQ(found("ΕΛΕΝΗ"), Names{"Ελένη"});
    EXPECT_EQ(found("nguyen"), Names{"Nguyễn"});
    EXPECT_EQ(found("rené"), Names{"Rene\xCC\x81"});
    EXPECT_EQ(cxFoldedForSearch("\xFF\xC3"), "\xFF\xC3") << "malformed text stays as it is";
}

TEST_F(WordSearch, UnsavedChangesAreFoundAndFormerTextsAreNot) {
    add("Ada", "");
    d->save();
    const CXPersonRef ada =
        std::dynamic_pointer_cast<CXPerson>(d->recordForUniqueId(d->peopleFound(CXSearchQuery("ada")).at(0).uniqueId));
    ada->setValue("Eve", kCXFirstNameProperty);
    EXPECT_EQ(found("ada"), Names{});
    EXPECT_EQ(found("eve"), Names{"Eve"});
    d->save();
    EXPECT_EQ(found("ada"), Names{});
    EXPECT_EQ(found("eve"), Names{"Eve"});
}

TEST_F(WordSearch, AFileOfTheFormatBeforeIsSearchedByNotesToo) {
    add("Ada", "0170 1234567", "Zürich");
    d->save();
    d.database.reset();
    Sqlite(d.path, 0).execute("DROP INDEX records_search; UPDATE records SET search=lower(display) WHERE kind=1; "
                              "PRAGMA user_version=6");
    d.database = d.open();
    EXPECT_EQ(found("zurich +49 170 1234567"), Names{"Ada"});
    d.database.reset();
    EXPECT_EQ(Sqlite(d.path, 0).integer("PRAGMA user_version"), 9);
}

TEST_F(WordSearch, PeopleWhoseNameBeginsSoAreGivenUpToANumber) {
    for (const char* name : {"Bob", "ada", "Adam", "Ada Miller", "Ädi", "Zoe"}) d.addPerson(name);
    d.addGroup("Adults");
    d->save();
    EXPECT_EQ(names(d->peopleBegun("AD", 10)), (Names{"ada", "Ada Miller", "Adam"}));
    EXPECT_EQ(names(d->peopleBegun("Ä", 10)), Names{"Ädi"});
    EXPECT_EQ(names(d->peopleBegun("x", 10)), Names{});
    EXPECT_EQ(d->peopleBegun("", 10).size(), 6u);
    EXPECT_EQ(names(d->peopleBegun("", 3)), (Names{"ada", "Ada Miller", "Ädi"})) << "the last of all is the last";
    EXPECT_EQ(names(d->peopleBegun("ad", 3)), (Names{"ada", "Ada Miller", "Adam"}));
    EXPECT_EQ(names(d->peopleBegun("ad", 2)), (Names{"ada", "Adam"}));
}

// Bytes that this process has read from files and pipes.
long bytesRead() {
    std::ifstream file("/proc/self/io");
    std::string key;
    long value = -1;
    file >> key >> value;
    EXPECT_EQ(key, "rchar:");
    return value;
}

TEST_F(WordSearch, ManyPeopleCostASearchTheirTextsAndTheBeginningOfANameNothing) {
    const std::string note(400, 'n'), photo(3000, 'p');
    constexpr int kPeople = 4000;
    for (int i = 0; i < kPeople; ++i) {
        const CXPersonRef person = d.addPerson("Person " + std::to_string(i));
        person->setValue(photo, kCXHomePageProperty); // a property that no search looks at
        if (i % 10 == 0) person->setValue(note, kCXNoteProperty);
    }
    d->save();
    const auto readBy = [&](const auto& work) {
        d.reopen();                             // with nothing in memory
        d->countPeople(RemoteLocation("none")); // the schema is read
        const long before = bytesRead();
        work();
        return bytesRead() - before;
    };
    const long whole = kPeople * 3000L;
    EXPECT_LT(readBy([&] { EXPECT_EQ(d->peopleBegun("person 39", 200).size(), 111u); }), 200'000);
    EXPECT_LT(readBy([&] { EXPECT_EQ(d->peopleBegun("", 200).size(), 200u); }), 200'000);
    EXPECT_LT(readBy([&] { EXPECT_EQ(found("person 3999").size(), 1u); }), whole / 8) << "the texts are read alone";
}

} // namespace
} // namespace rolvane::test
