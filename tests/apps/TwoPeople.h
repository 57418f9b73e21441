#pragma once

#include "Neighbour.h"

#include "contacts/database/CXRolvane.h"

#include <map>
#include <memory>
#include <random>
#include <string>
#include <vector>

namespace rolvane::test {

// Alice publishes people and groups, bob may write there and is subscribed. Their databases are edited as a contact
// application does it, by another process than the daemons.
class TwoPeople : public testing::Test {
protected:
    static constexpr size_t kGroups = 5;
    explicit TwoPeople(size_t people);
    ~TwoPeople() override;

    CXPersonRef personOf(CXRolvane& database, size_t i) const;
    CXGroupRef groupOf(CXRolvane& database, size_t i) const;
    // One edit, mostly of a name, else of a membership; the value is remembered with who has written it.
    void edit(CXRolvane& database, const std::string& who, int number);
    // What a database holds of alice's, by record; and what the store holds. Lists that name somebody twice say so.
    std::map<std::string, std::string> view(CXRolvane& database) const;
    // Whoever is put into a group while somebody else deletes the contact stays in the list on the store: a name
    // without a contact, which nobody takes for a member. Where two write at a time such names are left out.
    enum class Names { all, ofContacts };
    std::map<std::string, std::string> storeView(Names named = Names::all);
    void expectEqual(const std::map<std::string, std::string>& expected,
                     const std::map<std::string, std::string>& found, const std::string& what) const;
    void expectEverySurvivingNameWasWritten(CXRolvane& database) const;

    CommandWorld world;
    std::unique_ptr<Neighbour> bobsProgram;
    NotificationCenter aliceCenter, bobCenter;
    std::unique_ptr<CXRolvane> alice, bob;
    std::mt19937 random{20260612};
    std::vector<UniqueId> people, groups;
    std::map<std::string, std::set<std::string>> written; // by contact
    std::string location;
};

} // namespace rolvane::test
