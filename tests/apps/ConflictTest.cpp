// Two people who change one contact while the store is away.

#include "Neighbour.h"

namespace rolvane::test {
namespace {

class Conflict : public testing::Test {
protected:
    Conflict() {
        world.bus();
        world.makeAccount();
        world.add("Ada");
        world.done({"publish"});
        bob = std::make_unique<Neighbour>(world, "bob");
        world.done({"share", "bob", "--write"});
        bob->done({"subscribe", world.json({"status"})["store"]["location"]});
    }
    void goOffLine() { world.store().stop(PrivateStore::Stop::atOnce); }
    void comeBack() {
        world.store().start();
        settle();
    }
    void settle() {
        for (int round = 0; round < 2; ++round) {
            world.done({"sync"});
            bob->done({"sync"});
        }
    }
    static std::string propertyOf(const nlohmann::json& person, const char* property) {
        const auto& properties = person.at("properties");
        return properties.contains(property) ? properties.at(property).get<std::string>() : "nothing";
    }
    void expectOnBoth(const char* property, const std::string& value) {
        EXPECT_EQ(propertyOf(world.json({"show", "Ada"}), property), value);
        EXPECT_EQ(propertyOf(bob->json({"show", "Ada"}), property), value);
    }

    CommandWorld world;
    std::unique_ptr<Neighbour> bob;
};

TEST_F(Conflict, DifferentPropertiesAreBothThereAfterwards) {
    goOffLine();
    world.done({"edit", "Ada", "--nickname", "Countess"});
    bob->done({"edit", "Ada", "--org", "Engine"});
    comeBack();
    expectOnBoth("Nickname", "Countess");
    expectOnBoth("Organization", "Engine");
    EXPECT_TRUE(world.json({"status"})["conflicts"].empty());
    EXPECT_TRUE(bob->json({"status"})["conflicts"].empty());
}

TEST_F(Conflict, TheValueThatGaveWayIsToldAndPutBack) {
    goOffLine();
    world.done({"edit", "Ada", "--note", "Alice's"});
    bob->done({"edit", "Ada", "--note", "Bob's"});
    comeBack();
    const std::string kept = propertyOf(world.json({"show", "Ada"}), "Note");
    expectOnBoth("Note", kept);
    const std::string lost = kept == "Bob's" ? "Alice's" : "Bob's";

    // Whoever wrote last has met the other's version.
    const bool isHers = !world.json({"conflicts", "list"}).empty();
    const auto told = isHers ? world.json({"conflicts", "list"}) : bob->json({"conflicts", "list"});
    ASSERT_EQ(told.size(), 1u);
    EXPECT_EQ(told[0]["property"], "Note");
    EXPECT_EQ(told[0]["name"], "Ada");
    EXPECT_EQ(told[0]["kept"]["Note"], kept);
    EXPECT_EQ(told[0]["lost"]["Note"], lost);
    const std::string number = std::to_string(told[0]["number"].get<int>());
    const auto run = [&](const std::vector<std::string>& line) {
        return isHers ? world.rolvane(line) : bob->rolvane(line);
    };
    EXPECT_NE(run({"status"}).output.find("rolvane conflicts restore " + number), std::string::npos);
    EXPECT_NE(run({"conflicts", "list"}).output.find("\"" + lost + "\" gave way"), std::string::npos);

    const Ran restored = run({"conflicts", "restore", number});
    EXPECT_EQ(restored.status, kDone) << restored;
    settle();
    expectOnBoth("Note", lost);
    EXPECT_TRUE(saysOnce(run({"conflicts", "restore", number}), kNoSuchThing, "conflict " + number));
    EXPECT_TRUE(saysOnce(run({"conflicts", "forget", number}), kNoSuchThing, "conflict " + number));
}

} // namespace
} // namespace rolvane::test
