#pragma once

#include "StoreWorld.h"

#include <gtest/gtest.h>
#include <string>
#include <vector>

namespace rolvane::test {

// A client of a real store with three hundred contacts, whose requests count from here on. One store a suite.
template <class Suite>
struct ManyContacts : testing::Test {
    static constexpr int kContacts = 300;
    static void SetUpTestSuite() { world = new StoreWorld; }
    static void TearDownTestSuite() {
        delete world;
        world = nullptr;
    }
    ManyContacts() {
        client.manager.sanityCheckPublishStructureCreate(true);
        for (int i = 0; i < kContacts; ++i) client.write(name(i), Dictionary{{"number", i}});
        client.wire->clear();
    }
    static std::string name(int i) {
        return "People/" + std::to_string(i % 32) + "/" + std::to_string(i) + ":CXPerson";
    }
    std::vector<Url> all() const {
        std::vector<Url> urls;
        for (int i = 0; i < kContacts; ++i) urls.push_back(client.at(name(i)));
        return urls;
    }
    void readAll() {
        for (int i = 0; i < kContacts; ++i) {
            const auto content = client.manager.dictionaryAtURL(client.at(name(i)), true, nullptr);
            ASSERT_TRUE(content) << i;
            EXPECT_EQ((*content)["number"], Value(i));
        }
    }
    static inline StoreWorld* world = nullptr;
    Client client{*world};
};

} // namespace rolvane::test
