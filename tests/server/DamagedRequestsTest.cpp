#include "AccessWorld.h"
#include "foundation/Paths.h"

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <gtest/gtest.h>
#include <map>
#include <random>

// Bodies of reports, and If headers, with damage of all kinds, sent to httpd whose mod_davacl watches its own memory:
// the world fails the test when it had something to say. The same requests at each run; ROLVANE_TEST_SEED makes others,
// ROLVANE_TEST_ROUNDS more of them, and ROLVANE_TEST_SECONDS as many as that time allows.

namespace rolvane {
namespace {

unsigned number(const char* variable, unsigned usual) {
    const char* text = std::getenv(variable);
    return text ? static_cast<unsigned>(std::strtoul(text, nullptr, 10)) : usual;
}

// Whether another round is due.
class Rounds {
public:
    ~Rounds() { std::printf("%u rounds\n", _made); }
    bool more() {
        const bool due =
            _seconds > 0 ? std::chrono::steady_clock::now() - _began < std::chrono::seconds(_seconds) : _made < _rounds;
        _made += due;
        return due;
    }

private:
    static constexpr unsigned kUsual = 600;
    const unsigned _seconds = number("ROLVANE_TEST_SECONDS", 0), _rounds = number("ROLVANE_TEST_ROUNDS", kUsual);
    const std::chrono::steady_clock::time_point _began = std::chrono::steady_clock::now();
    unsigned _made = 0;
};

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
    R"(<D:principal-search-property-set xmlns:D="DAV:"/>)",
    R"(<D:sync-collection xmlns:D="DAV:"><D:sync-token/><D:sync-level>infinite</D:sync-level><D:limit><D:nresults>2</D:nresults></D:limit>)"
    R"(<D:prop><D:getetag/><x xmlns="urn:a&amp;b"/></D:prop></D:sync-collection>)",
    R"(<D:sync-collection xmlns:D="DAV:"><D:sync-token>urn:x-rolvane:tree:d:1a:2b:3:17c0:ff:1:2:1</D:sync-token><D:sync-level>1</D:sync-level>)"
    R"(<D:prop><D:acl/><D:getetag/></D:prop></D:sync-collection>)",
    R"(<R:news xmlns:R="http://rolvane.net/ns/" xmlns:D="DAV:"><D:href>/dav/alice/Contacts/</D:href><D:href>/dav/alice/</D:href>)"
    R"(<D:href>http://localhost/dav/sam/</D:href><R:since>3f5a0b1c22d94e6780aa61c5d7e8f902</R:since></R:news>)"};

std::string many(const std::string& piece, int times) {
    std::string text;
    while (times-- > 0) text += piece;
    return text;
}

bool mayBeNews(const std::string& body) {
    return body.find("news") != std::string::npos;
}

class DamagedRequests : public testing::Test {
protected:
    DamagedRequests() : world(AccessVariant::sanitized) {
        world.reset();
        EXPECT_EQ(world.status("alice", "PUT", "/dav/alice/secret", {}, kSecret), 201);
    }
    Rounds rounds;
    static constexpr const char* kSecret = "told-to-nobody-else";
    // The answer to a report of news ends with its connection: the first lines are enough.
    RawAnswer report(const std::string& user, const std::string& place, const std::string& body) {
        if (!mayBeNews(body)) return world.ask(user, "REPORT", place, {}, body);
        RawLines lines(world.port(), {user, "REPORT", place, {}, body});
        RawAnswer answer;
        answer.status = lines.status();
        if (answer.status == 200) answer.body = lines.line().value_or("");
        return answer;
    }
    // Everything in alice's trees, as it lies on the disk.
    std::map<std::string, std::string> allOfAlice() const {
        std::map<std::string, std::string> all;
        const std::filesystem::path trees = world.store.stateDirectory() + "/root/dav/alice";
        for (const auto& each : std::filesystem::recursive_directory_iterator(trees))
            all[each.path()] = each.is_directory() ? "" : readFile(each.path());
        return all;
    }
    AccessWorld world;
    Damage damage;
};

TEST_F(DamagedRequests, NoReportTellsMoreThanItMayOrEndsTheServer) {
    const std::vector<std::string> places = {"/dav/alice/Contacts/", "/dav/", "/principals/", "/principals/users/rita",
                                             "/dav/alice/Contacts/People/"};
    unsigned answered = 0;
    while (rounds.more()) {
        const std::string body = damage.of(damage.oneOf(kReports));
        const std::string& place = damage.oneOf(places);
        for (const char* user : {"rita", "sam"}) {
            const RawAnswer answer = report(user, place, body);
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
        "</dav/alice/own> (<DAV:no-lock>) </dav/alice/secret> (Not <DAV:no-lock> [W/\"x\"])",
        "",
        "([\"x\"][W/\"y\"] Not [\"z\"] <opaquelocktoken:1>) (Not <urn:x> Not [\"a\"]) (<DAV:no-lock>)",
        "<http://elsewhere/dav/alice/secret> (Not <DAV:no-lock>) <https://localhost:1/dav/alice/secret> (Not <urn:x>)",
        "<http://[::1/%zz%00/..//secret> (Not <DAV:no-lock>) </dav/alice/secret/../own> (Not <opaquelocktoken:>)",
        std::string(7000, '(') + "Not <DAV:no-lock>",
        "(" + many("Not <urn:uuid:2> ", 400) + ")"};
    while (rounds.more()) {
        std::string value = damage.of(damage.oneOf(headers));
        std::erase_if(value, [](char c) { return c == '\n' || c == '\r' || c == '\0'; });
        if (value.find(token) != std::string::npos) continue; // damage has mended it
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

// A stranger spells places of somebody else in every way, as the target of a request and as the Destination of one.
TEST_F(DamagedRequests, NoPathLeadsAStrangerToWhatIsAlices) {
    const std::vector<std::string> paths = {"/dav/alice/secret",
                                            "/dav/sam/../alice/secret",
                                            "/dav/sam/%2e%2e/alice/%73ecret",
                                            "/dav/sam/..%2falice%2fsecret",
                                            "//dav//alice/./secret",
                                            "/dav/alice%00/secret",
                                            "/principals/../dav/alice/Contacts/",
                                            "http://localhost/dav/alice/secret",
                                            "/dav/sam/x;/../../alice/secret?x#y",
                                            "/dav/sam/%c0%ae%c0%ae/alice/secret",
                                            "/DAV/Alice/secret",
                                            "/dav/sam/own"};
    const std::vector<std::string> methods = {"GET",  "PUT",  "DELETE", "PROPFIND", "PROPPATCH", "MKCOL",
                                              "COPY", "MOVE", "LOCK",   "ACL",      "REPORT",    "OPTIONS"};
    const auto before = allOfAlice();
    ASSERT_TRUE(before.size() > 3);
    unsigned refused = 0;
    while (rounds.more()) {
        const auto path = [&] {
            std::string text = damage.of(damage.oneOf(paths));
            std::erase_if(text, [](char c) { return c == '\n' || c == '\r' || c == ' ' || c == '\t'; });
            return text.empty() ? std::string("/") : text;
        };
        const std::string& method = damage.oneOf(methods);
        const bool two = method == "COPY" || method == "MOVE";
        const std::string target = path(), destination = two ? path() : std::string();
        std::vector<std::pair<std::string, std::string>> headers;
        if (two) headers = {{"Destination", destination}, {"Overwrite", "T"}};
        const bool hasBody = method != "GET" && method != "DELETE" && method != "MKCOL" && !two;
        const std::string body = !hasBody          ? ""
                                 : method == "ACL" ? AccessWorld::acl(AccessWorld::ace(AccessWorld::user("sam"), "all"))
                                 : method == "LOCK" ? AccessWorld::kLock
                                 : method == "PUT"  ? "written by a stranger"
                                                    : AccessWorld::propfind("getetag");
        const RawAnswer answer = world.ask("sam", method, target, headers, body);
        const std::string what = method + " " + target + (two ? " to " + destination : "");
        ASSERT_NE(answer.status, 0) << what;
        EXPECT_TRUE(answer.status < 500 || answer.status == 501 || answer.status == 502)
            << answer.status << " to " << what;
        EXPECT_EQ(answer.body.find(kSecret), std::string::npos) << what;
        refused += answer.status == 403;
    }
    EXPECT_GT(refused, 0u) << "no request came near";
    EXPECT_EQ(allOfAlice(), before);
}

} // namespace
} // namespace rolvane
