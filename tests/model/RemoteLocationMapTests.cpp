#include "model/RemoteLocationMap.h"

#include <gtest/gtest.h>

namespace rolvane {
namespace {

std::optional<UserName> userOf(const char* location, std::optional<UserName> account = UserName("ann"),
                               const std::string& login = "annlogin") {
    return userForRemoteLocation(RemoteLocation(location), account, login);
}

TEST(RemoteLocationMap, KnowsTheConduitByACaseSensitivePrefix) {
    const auto conduit = [](const char* text) { return conduitIDForRemoteLocation(RemoteLocation(text)); };
    EXPECT_EQ(conduit("http://store.example/ann/Contacts"), "CXDVaultra");
    EXPECT_EQ(conduit("file:/usr/share/rolvane/ann"), "CXDLocal");
    EXPECT_EQ(conduit("file:///usr/share/rolvane/ann"), "CXDLocal");
    EXPECT_EQ(conduit("https://store.example/ann/Contacts"), std::nullopt);
    EXPECT_EQ(conduit("HTTP://store.example/ann/Contacts"), std::nullopt);
    EXPECT_EQ(conduit("local"), std::nullopt);
    EXPECT_EQ(conduit(""), std::nullopt);
}

TEST(RemoteLocationMap, GivesTheSourceBitOrZero) {
    EXPECT_EQ(syncSourceForRemoteLocation(RemoteLocation("http://store.example/ann")), 4);
    EXPECT_EQ(syncSourceForRemoteLocation(RemoteLocation("file:/usr/share/rolvane/ann")), 2);
    EXPECT_EQ(syncSourceForRemoteLocation(RemoteLocation("local")), 0);
    EXPECT_EQ(syncSourceForRemoteLocation(RemoteLocation("https://store.example/ann")), 0);
}

TEST(RemoteLocationMap, TheAccountsOwnTreeIsTheOwnersWhateverItsLetterCase) {
    EXPECT_EQ(userOf("http://store.example:8080/ann/Contacts"), kSelf);
    EXPECT_EQ(userOf("http://store.example/ANN/Contacts"), kSelf);
    EXPECT_EQ(userOf("http://store.example/bob/Contacts"), UserName("bob"));
    EXPECT_EQ(userOf("http://store.example/Bob%20B/Contacts"), UserName("Bob B"));
}

TEST(RemoteLocationMap, WithoutAnAccountNobodyOwnsAStoreLocation) {
    EXPECT_EQ(userOf("http://store.example/ann/Contacts", std::nullopt), UserName("ann"));
    EXPECT_EQ(userOf("http://store.example/", UserName("")), UserName(""));
}

TEST(RemoteLocationMap, TheLoginUsersFolderIsTheOwnersWhenTheNameIsExactlyThatOne) {
    EXPECT_EQ(userOf("file:/usr/share/rolvane/annlogin"), kSelf);
    EXPECT_EQ(userOf("file:/usr/share/rolvane/annlogin/Contacts"), kSelf);
    EXPECT_EQ(userOf("file:/usr/share/rolvane/ANNLOGIN"), UserName("ANNLOGIN"));
    EXPECT_EQ(userOf("file:/usr/share/rolvane/bob"), UserName("bob"));
}

TEST(RemoteLocationMap, APathThatIsTooShortBelongsToNobody) {
    EXPECT_EQ(userOf("http://store.example"), UserName(""));
    EXPECT_EQ(userOf("file:/usr/share/rolvane"), UserName(""));
    EXPECT_EQ(userOf("file:/usr/share/rolvane", UserName("ann"), ""), UserName(""));
}

TEST(RemoteLocationMap, ALocationThatNoConduitServesHasNoUser) {
    EXPECT_EQ(userOf("https://store.example/ann/Contacts"), std::nullopt);
    EXPECT_EQ(userOf("local"), std::nullopt);
}

} // namespace
} // namespace rolvane
