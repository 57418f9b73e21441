#include "AccessWorld.h"
#include "foundation/Paths.h"

#include <cstdlib>
#include <gtest/gtest.h>
#include <random>

// Bodies of reports, and If headers, with damage of all kinds, sent to httpd whose mod_davacl watches its own memory:
// the world fails the test when it had something to say. The same requests at each run; ROLVANE_TEST_SEED makes others,
// and ROLVANE_TEST_ROUNDS more of them.

namespace rolvane {
namespace {

unsigned number(const char* variable, unsigned usual) {
    const char* text = std::getenv(variable);
    return text ? static_cast<unsigned>(std::strtoul(text, nullptr, 10)) : usual;
}

class Damage {
public:
    std::string of(std::string text) {
        for (auto changes = _random() % 5; changes > 0 && !text.empty(); --changes) {
            const size_t at = _random() % text.size(), length = 1 + _random() % 12;
            switch (_random() % 5) {
            case 0: text[at] = kBytes[_random() % kBytes.size()]; break;
            case 1: text.erase(at, length); break;
            case 2: text.insert(at, text, _random() % text.size(), length); break;
            case 3: text.insert(at, std::string(_random() % 300, text[at])); break;
            default: text.insert(at, kPieces[_random() % kPieces.size()]); break;
            }
        }
        return text;
    }
    template <class All>
    const auto& oneOf(const All& all) {
        return all[_random() % std::size(all)];
    }

private:
    const std::string kBytes = "<>/\"'&;:()[]% \t\n=AZaz09-_.!\x7f\xc3\xff";
    const std::vector<std::string> kPieces = {"<D:property name=\"owner\">",
                                              "</D:property>",
                                              "<D:prop>",
                                              "<D:href>/principals/users/alice</D:href>",
                                              "<!DOCTYPE x>",
                                              "&amp;",
                                              "()",
                                              "Not ",
                                              "<opaquelocktoken:1>",
                                              "[\"a\"]",
                                              "<http://localhost/dav/alice/own> "};
    std::mt19937 _random{number("ROLVANE_TEST_SEED", 22)};
};

const std::vector<std::string> kReports = {
    R"(<D:expand-property xmlns:D="DAV:"><D:property name="owner"><D:property name="displayname"/><D:property name="group-membership">)"
    R"(<D:property name="displayname"/></D:property></D:property><D:property name="acl"/></D:expand-property>)",
    R"(<D:acl-principal-prop-set xmlns:D="DAV:"><D:prop><D:displayname/><D:principal-URL/></D:prop></D:acl-principal-prop-set>)",
    R"(<D:principal-match xmlns:D="DAV:"><D:principal-property><D:owner/></D:principal-property><D:prop><D:getetag/></D:prop></D:principal-match>)",
    R"(<D:principal-match xmlns:D="DAV:"><D:self/><D:prop><D:displayname/></D:prop></D:principal-match>)",
    R"(<D:principal-property-search xmlns:D="DAV:"><D:apply-to-principal-collection-set/><D:property-search><D:prop><D:displayname/></D:prop>)"
    R"(<D:match>alice</D:match></D:property-search><D:prop><D:displayname/></D:prop></D:principal-property-search>)",
    R"(<D:principal-search-property-set xmlns:D="DAV:"/>)"};

class DamagedRequests : public testing::Test {
protected:
    DamagedRequests() : world(AccessVariant::sanitized) {
        world.reset();
        EXPECT_EQ(world.status("alice", "PUT", "/dav/alice/secret", {}, kSecret), 201);
    }
    static constexpr unsigned kRounds = 600;
    static constexpr const char* kSecret = "told-to-nobody-else";
    AccessWorld world;
    Damage damage;
};

TEST_F(DamagedRequests, NoReportTellsMoreThanItMayOrEndsTheServer) {
    const std::vector<std::string> places = {"/dav/alice/Contacts/", "/dav/", "/principals/", "/principals/users/rita",
                                             "/dav/alice/Contacts/People/"};
    unsigned answered = 0;
    for (unsigned i = 0; i < number("ROLVANE_TEST_ROUNDS", kRounds); ++i) {
        const std::string body = damage.of(damage.oneOf(kReports));
        const std::string& place = damage.oneOf(places);
        for (const char* user : {"rita", "sam"}) {
            const RawAnswer answer = world.ask(user, "REPORT", place, {}, body);
            ASSERT_NE(answer.status, 0) << body;
            answered += answer.status == 207;
            // 501: mod_dav knows no such report.
            EXPECT_TRUE(answer.status < 500 || answer.status == 501) << answer.status << " to " << body;
            EXPECT_EQ(answer.body.find("secret"), std::string::npos) << user << ": " << body;
            if (std::string(user) == "sam" && place.starts_with("/dav/alice")) {
                EXPECT_EQ(answer.status, 403) << body;
            }
        }
    }
}

TEST_F(DamagedRequests, NoIfHeaderWritesPastALockOrAList) {
    const RawAnswer locked = world.ask("alice", "LOCK", "/dav/alice/secret", {}, AccessWorld::kLock);
    const size_t at = locked.body.find("opaquelocktoken:");
    ASSERT_NE(at, std::string::npos) << locked.body;
    const std::string token = locked.body.substr(at, locked.body.find('<', at) - at);
    // None of these is the token itself, and one that damage makes of them is none either.
    const std::vector<std::string> headers = {
        "(<opaquelocktoken:00000000-0000-0000-0000-000000000000>)",
        "(Not <DAV:no-lock>)",
        "([\"a\"] Not <DAV:no-lock>)",
        "<http://localhost/dav/alice/secret> (Not <urn:x>) (<urn:y>)",
        "(<" + token.substr(0, token.size() - 1) + ">)",
        "</dav/alice/own> (<DAV:no-lock>) </dav/alice/secret> (Not <DAV:no-lock> [W/\"x\"])"};
    for (unsigned i = 0; i < number("ROLVANE_TEST_ROUNDS", kRounds); ++i) {
        std::string value = damage.of(damage.oneOf(headers));
        std::erase_if(value, [](char c) { return c == '\n' || c == '\r' || c == '\0'; });
        const RawAnswer own = world.ask("alice", "PUT", "/dav/alice/secret", {{"If", value}}, "without the token");
        ASSERT_NE(own.status, 0) << value;
        EXPECT_TRUE(own.status >= 400 && own.status < 500) << own.status << " to If: " << value;
        const RawAnswer others = world.ask("walter", "PUT", "/dav/alice/secret", {{"If", value}}, "without the right");
        EXPECT_TRUE(others.status == 403 || others.status == 400) << others.status << " to If: " << value;
    }
    EXPECT_EQ(world.ask("alice", "GET", "/dav/alice/secret").body, kSecret);
    const std::string real = "(<" + token + ">)";
    EXPECT_EQ(world.status("walter", "PUT", "/dav/alice/secret", {{"If", real}}, "x"), 403) << "a token is no right";
    EXPECT_EQ(world.status("alice", "PUT", "/dav/alice/secret", {{"If", real}}, "x"), 204) << "the lock is another one";
}

} // namespace
} // namespace rolvane
