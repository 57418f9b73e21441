// Stores that lose a part of what they held.

#include "TwoUsers.h"

namespace rolvane::test {

class StoreLoss : public TwoUsers {};

TEST_F(StoreLoss, ALostListOfEverybodyRemovesNoContactButTheGroupsThatItNamed) {
    bob.pass();
    ASSERT_EQ(bob.application->listGroups(RemoteLocation(alice.base)).size(), 1u);
    const std::filesystem::path list = world->file("AllCXGroup");
    ASSERT_TRUE(std::filesystem::exists(list));
    std::filesystem::remove_all(list);
    for (int pass = 0; pass < 2; ++pass) {
        bob.pass();
        EXPECT_EQ(bob.countPeople(alice.base), 3u) << log.text();
        EXPECT_TRUE(bob.application->listGroups(RemoteLocation(alice.base)).empty());
    }
    alice.pass();
    EXPECT_EQ(alice.countPeople(), 3u);
}

} // namespace rolvane::test
