#include "BooksWorld.h"

#include "foundation/Paths.h"
#include "foundation/Sqlite.h"

#include <algorithm>
#include <apr_general.h>
#include <apr_xml.h>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits>
#include <sstream>

// Requests of somebody who knows a device's password, or who shares contacts with the owner, and means harm.

namespace rolvane {
namespace {

using testing::HasSubstr;

const std::string kBook = kContacts;

std::string repeated(size_t times, const std::string& text) {
    std::string all;
    for (size_t i = 0; i < times; ++i) {
        all += text;
        const size_t mark = all.size() - text.size() + text.find('#');
        if (text.find('#') != std::string::npos) all.replace(mark, 1, std::to_string(i));
    }
    return all;
}

// Why a strict reader takes the body for no XML; "" when it does not.
std::string complaintOfReader(const std::string& body) {
    static const bool ready = apr_initialize() == APR_SUCCESS;
    apr_pool_t* pool = nullptr;
    if (!ready || apr_pool_create(&pool, nullptr) != APR_SUCCESS) return "no pool";
    apr_xml_parser* parser = apr_xml_parser_create(pool);
    apr_xml_doc* document = nullptr;
    const bool fed = apr_xml_parser_feed(parser, body.data(), body.size()) == APR_SUCCESS;
    const bool read = apr_xml_parser_done(parser, &document) == APR_SUCCESS && fed;
    char text[256] = "";
    if (!read) apr_xml_parser_geterror(parser, text, sizeof text);
    const std::string complaint = text;
    apr_pool_destroy(pool);
    return read ? "" : complaint.empty() ? "it cannot be read" : complaint;
}

// The numbers of the server's workers in /proc.
std::vector<std::string> workersOf(const BooksWorld& world) {
    const std::string pid = std::to_string(world.server());
    std::ifstream children("/proc/" + pid + "/task/" + pid + "/children");
    std::vector<std::string> all;
    for (std::string worker; children >> worker;) all.push_back(worker);
    return all;
}

// Nanoseconds that the workers' threads have had of the processors.
uint64_t processorTime(const BooksWorld& world) {
    uint64_t sum = 0;
    for (const std::string& worker : workersOf(world))
        for (const auto& task : std::filesystem::directory_iterator("/proc/" + worker + "/task")) {
            uint64_t nanoseconds = 0;
            std::ifstream(task.path() / "schedstat") >> nanoseconds;
            sum += nanoseconds;
        }
    return sum;
}

long mostMegabytes(const BooksWorld& world) {
    long most = 0;
    for (const std::string& worker : workersOf(world)) {
        std::istringstream lines(readFile("/proc/" + worker + "/status"));
        for (std::string line; std::getline(lines, line);)
            if (line.starts_with("VmHWM:")) most = std::max(most, std::atol(line.c_str() + 6) / 1024);
    }
    return most;
}

int64_t countIn(const BooksWorld& world, const std::string& what) {
    Sqlite memory(world.database() + ".books", 5000);
    return memory.integer("SELECT count(*) FROM " + what);
}

// Publishers choose the characters of what they share, and one card would take the whole book from every program.
TEST(Attacks, NoCharacterOfACardMakesAnAnswerUnreadable) {
    BooksWorld world;
    const std::string noCharacters = "a\xEF\xBF\xBE"
                                     "b\xEF\xBF\xBF"
                                     "c\x7F";
    const auto person = world.addPerson("Ann", "Lee", {{kCXNoteProperty, noCharacters}});
    const auto group = world.addGroup("G" + noCharacters, {person});
    world.put(kBook + "own.vcf", cardOf("own-1", "Own", "Card", "NOTE:" + noCharacters + "\r\n"));
    const std::string book = "/books/home/group-" + BooksWorld::uuidOf(group) + "/";
    const std::string card = kBook + BooksWorld::uuidOf(person) + ".vcf";
    for (const BookAnswer& answer :
         {world.multiget(kBook, {card, kBook + "own.vcf", kBook + BooksWorld::uuidOf(group) + ".vcf"}),
          world.propfind("/books/home/", 1, "<D:displayname/><C:addressbook-description/>"),
          world.propfind(book, 0, "<D:displayname/>"), world.sync(kBook, "")}) {
        EXPECT_EQ(answer.status, 207);
        EXPECT_EQ(complaintOfReader(answer.body), "") << answer.body;
    }
}

// Both cost the square of their number once: a second of a group of 20,000, minutes of one of 400,000.
TEST(Attacks, MembersThatAreNowhereCostNoMoreThanTheirNumber) {
    uint64_t least[2] = {std::numeric_limits<uint64_t>::max(), std::numeric_limits<uint64_t>::max()};
    constexpr size_t kNumbers[] = {20000, 40000};
    BooksWorld world;
    const auto ratio = [&] { return static_cast<double>(least[1]) / static_cast<double>(least[0]); };
    constexpr int kRounds = 8, kFirst = 2;
    constexpr double kMost = 3;
    for (int round = 0; round < kFirst || (round < kRounds && ratio() > kMost); ++round)
        for (const size_t which : {0, 1}) {
            const std::string name = std::to_string(round) + "-" + std::to_string(which);
            const std::string card =
                cardOf("group-" + name, "A", "group",
                       "X-ADDRESSBOOKSERVER-KIND:group\r\n" +
                           repeated(kNumbers[which], "X-ADDRESSBOOKSERVER-MEMBER:urn:uuid:nobody-#\r\n"));
            const uint64_t before = processorTime(world);
            for (const int status : {201, 204})
                ASSERT_EQ(world.put(kBook + name + ".vcf", card).status, status) << world.log();
            least[which] = std::min(least[which], processorTime(world) - before);
        }
    std::printf("%.0f ms for 20,000, %.0f for 40,000: %.2f\n", static_cast<double>(least[0]) / 1e6,
                static_cast<double>(least[1]) / 1e6, ratio());
    EXPECT_LE(ratio(), kMost);
}

TEST(Attacks, ACardHasNoMoreLinesThanAnybodyHas) {
    BooksWorld world;
    const int64_t position = world.rolvane().journalPosition();
    const std::string member = "X-ADDRESSBOOKSERVER-KIND:group\r\n";
    for (const std::string& lines :
         {repeated(1100, "X-LINE-#:x\r\n"), repeated(1100, "TEL:+1 555 #\r\n"),
          "CATEGORIES:" + repeated(1100, "c#,") + "last\r\n", "TEL;TYPE=" + repeated(1100, "t#,") + "last:1\r\n",
          "TEL" + repeated(1100, ";P#=x") + ":1\r\n", member + repeated(1100, "X-LINE-#:x\r\n")}) {
        const BookAnswer answer = world.put(kBook + "many.vcf", cardOf("many", "Many", "Lines", lines));
        EXPECT_EQ(answer.status, 403) << lines.substr(0, 40);
        EXPECT_EQ(answer.precondition(), "valid-address-data") << lines.substr(0, 40);
    }
    EXPECT_EQ(world.rolvane().journalPosition(), position) << "nothing was saved";
    EXPECT_EQ(world.put(kBook + "many.vcf", cardOf("many", "Many", "Lines", repeated(900, "TEL:+1 555 #\r\n"))).status,
              201);
}

// The names of properties that a device has written stay when its cards have gone.
TEST(Attacks, WhatADeviceUnderstandsIsBounded) {
    BooksWorld world;
    for (int i = 0; i < 7; ++i) {
        const std::string lines = repeated(900, "X-" + std::to_string(i) + "-#:x\r\n");
        const BookAnswer answer = world.put(kBook + "card.vcf", cardOf("card", "Ann", "Lee", lines));
        ASSERT_EQ(answer.status, i == 0 ? 201 : i < 5 ? 204 : 403) << i << answer.body;
    }
    EXPECT_EQ(countIn(world, "knows"), 4501) << "what the five had, and the one that keeps a UID";
    EXPECT_EQ(world.put(kBook + "card.vcf", cardOf("card", "Ann", "Lee", "X-0-1:y\r\n")).status, 204);
}

TEST(Attacks, ACardThatIsGoneLeavesNoTextBehind) {
    BooksWorld world;
    for (int i = 0; i < 3; ++i) {
        const std::string name = kBook + "card" + std::to_string(i) + ".vcf";
        ASSERT_EQ(world.put(name, cardOf("card" + std::to_string(i), "Ann", "Lee", "NOTE:secret\r\n")).status, 201);
    }
    ASSERT_EQ(countIn(world, "written"), 3);
    EXPECT_EQ(world.ask("DELETE", kBook + "card0.vcf").status, 204);
    world.rolvane().removeRecord(
        world.rolvane().recordForUniqueId(world.rolvane().listPeople(std::nullopt).front().uniqueId));
    world.rolvane().save();
    EXPECT_EQ(world.sync(kBook, "").status, 207);
    EXPECT_EQ(countIn(world, "written"), 1);
}

// Each name is looked for at each line of each card, and no answer grows by it.
TEST(Attacks, AReportNamesNoMorePropertiesThanThereAre) {
    BooksWorld world;
    const auto person = world.addPerson("Ann", "Lee");
    const std::string card = kBook + BooksWorld::uuidOf(person) + ".vcf";
    const auto data = [](size_t times) {
        return "<C:address-data><C:prop name=\"FN\"/>" + repeated(times, "<C:prop name=\"X-#\"/>") +
               "</C:address-data>";
    };
    EXPECT_EQ(world.multiget(kBook, {card}, data(1100)).status, 400);
    EXPECT_EQ(world.multiget(kBook, {card}, repeated(1100, "<D:x#/>")).status, 400);
    const BookAnswer answer = world.multiget(kBook, {card}, data(500));
    EXPECT_EQ(answer.status, 207);
    EXPECT_THAT(answer.body, HasSubstr("FN:Ann Lee"));
}

TEST(Attacks, OneLargeCardThatIsAskedForOftenTakesNoMemory) {
    BooksWorld world;
    const std::string text(8 << 20, 'x');
    ASSERT_EQ(world.put(kBook + "large.vcf", cardOf("large", "Ann", "Lee", "NOTE:" + text + "\r\n")).status, 201);
    ASSERT_EQ(world.multiget(kBook, {kBook + "large.vcf"}).status, 207);
    const long before = mostMegabytes(world);
    const BookAnswer answer = world.multiget(kBook, std::vector<std::string>(40, kBook + "large.vcf"));
    EXPECT_EQ(answer.status, 207);
    EXPECT_GT(answer.body.size(), 40 * text.size());
    EXPECT_LT(mostMegabytes(world) - before, 100);
}

} // namespace
} // namespace rolvane
