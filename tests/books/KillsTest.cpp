#include "BooksWorld.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <random>
#include <set>
#include <unistd.h>

// Workers that end at any moment, and the same requests with sanitizers.

namespace rolvane {
namespace {

unsigned seedOfTest() {
    const char* given = std::getenv("ROLVANE_TEST_SEED");
    return given ? static_cast<unsigned>(std::atoi(given)) : std::random_device()();
}

TEST(Kills, LoseAndDoubleNothing) {
    const unsigned seed = seedOfTest();
    SCOPED_TRACE("ROLVANE_TEST_SEED=" + std::to_string(seed));
    std::mt19937 random(seed);
    BooksWorld world;
    world.addPerson("Zoe", "First");
    std::set<std::string> expected;
    for (const auto& each : world.propfind(kContacts, 1, "<D:getetag/>").responses()) expected.insert(each.href);
    for (int i = 0; i < 8; ++i) {
        const std::string name = kContacts + std::string("n") + std::to_string(i) + ".vcf";
        const std::string card = cardOf("urn:killed:" + std::to_string(i), "N" + std::to_string(i), "X");
        {
            RawUpload upload(world.port(), {"laptop", "PUT", name, {{"Content-Type", "text/vcard"}}, card},
                             card.size());
            usleep(std::uniform_int_distribution<useconds_t>(0, 20000)(random)); // a random moment
            world.killWorkers();
        }
        // As a client does that got no answer: the same once more, until there is one.
        int status = 0;
        for (int attempt = 0; attempt < 100 && status == 0; ++attempt)
            status = world.put(name, card, {{"If-None-Match", "*"}}).status;
        EXPECT_TRUE(status == 201 || status == 412) << status << world.log();
        expected.insert(name);
    }
    std::set<std::string> served;
    for (const auto& each : world.propfind(kContacts, 1, "<D:getetag/>").responses()) served.insert(each.href);
    EXPECT_EQ(served, expected) << "each under its own name";
    EXPECT_EQ(world.rolvane().countPeople(RemoteLocation("")), 9u) << "each once";
}

TEST(Sanitized, EveryMethodGoesThrough) {
    BooksWorld::Options options;
    options.sanitized = true;
    BooksWorld world(options);
    const auto ann = world.addPerson("Ann", "Lee");
    const auto group = world.addGroup("Friends", {ann});
    const auto shared = world.addSubscription("https://a.example/dav/walter", true, "Yan");
    const std::string book = "/books/home/group-" + BooksWorld::uuidOf(group) + "/";
    const std::string path = kContacts + BooksWorld::uuidOf(ann) + ".vcf";
    for (const char* place : {"/books/", "/books/principal/", "/books/home/", kContacts})
        EXPECT_EQ(world.ask("PROPFIND", place, {{"Depth", "1"}}).status, 207) << world.log();
    EXPECT_EQ(world.ask("OPTIONS", kContacts).status, 200);
    EXPECT_EQ(world.ask("GET", kContacts).status, 200);
    EXPECT_EQ(world.ask("HEAD", path).status, 200);
    const auto got = world.ask("GET", path);
    EXPECT_EQ(world.put(path, got.body, {{"If-Match", got.tag()}}).status, 204);
    EXPECT_EQ(world.put(path, cardOf("urn:uuid:" + BooksWorld::uuidOf(ann), "Ann", "Leigh"), {}, "phone").status, 204);
    EXPECT_EQ(world.put(std::string(kContacts) + "n.vcf", cardOf("n", "New", "One")).status, 201);
    EXPECT_EQ(world.put(std::string(kContacts) + "n.vcf", "rubbish").status, 403);
    EXPECT_EQ(world.ask("COPY", std::string(kContacts) + "n.vcf", {{"Destination", book + "n.vcf"}}).status, 201);
    EXPECT_EQ(world.ask("MOVE", book + "n.vcf", {{"Destination", std::string(kContacts) + "n.vcf"}}).status, 204);
    EXPECT_EQ(world.ask("MKCOL", "/books/home/x/").status, 403);
    const std::string token = world.sync(kContacts, "").syncToken();
    EXPECT_EQ(world.ask("DELETE", path).status, 204);
    EXPECT_EQ(world.sync(kContacts, token).status, 207);
    EXPECT_EQ(world.sync(kContacts, "urn:else").status, 403);
    EXPECT_EQ(world.multiget(kContacts, {path, std::string(kContacts) + "n.vcf", "%"}).status, 207);
    EXPECT_EQ(world
                  .report(kContacts,
                          "<C:addressbook-query xmlns:D=\"DAV:\" xmlns:C=\"urn:ietf:params:xml:ns:carddav\"><D:prop>"
                          "<C:address-data/></D:prop><C:filter><C:prop-filter name=\"FN\"><C:text-match>n"
                          "</C:text-match></C:prop-filter></C:filter></C:addressbook-query>")
                  .status,
              207);
    EXPECT_EQ(world.propfind("/books/home/shared-" + BooksWorld::uuidOf(shared) + "/", 1, "<D:getetag/>").status, 207);
    world.restart();
    EXPECT_EQ(world.sync(kContacts, token).status, 207);
    for (const char* complaint : {"AddressSanitizer", "runtime error"})
        EXPECT_EQ(world.log().find(complaint), std::string::npos) << world.log();
}

} // namespace
} // namespace rolvane
