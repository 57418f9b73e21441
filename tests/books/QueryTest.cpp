#include "BooksWorld.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <set>

// addressbook-query (RFC 6352 section 8.6) by raw HTTP.

namespace rolvane {
namespace {

using testing::HasSubstr;
using Names = std::set<std::string>;

class Queries : public testing::Test {
protected:
    Queries() {
        CXMutableMultiValue home, work;
        home.addValue("+49 30 1", kCXHomeLabel);
        work.addValue("+49 40 2", kCXWorkLabel);
        world.addPerson("Ann", "Öztürk", {{kCXNoteProperty, "comma, here"}, {kCXPhoneProperty, home.toValue()}});
        world.addPerson("Bob", "May", {{kCXPhoneProperty, work.toValue()}});
        world.addPerson("Cem", "Mayer");
    }

    BookAnswer query(const std::string& filter, const std::string& more = {}) const {
        return world.report(kContacts,
                            "<C:addressbook-query xmlns:D=\"DAV:\" xmlns:C=\"urn:ietf:params:xml:ns:carddav\">"
                            "<D:prop><D:getetag/><C:address-data/></D:prop>" +
                                filter + more + "</C:addressbook-query>");
    }
    // The first names of those who meet it.
    Names found(const std::string& filter, const std::string& attributes = {}) const {
        const auto answer = query("<C:filter" + attributes + ">" + filter + "</C:filter>");
        EXPECT_EQ(answer.status, 207) << answer.body;
        Names names;
        for (const BookResponse& each : answer.responses())
            for (const char* name : {"Ann", "Bob", "Cem"})
                if (each.card().find(std::string("FN:") + name) != std::string::npos) names.insert(name);
        return names;
    }
    static std::string property(const std::string& name, const std::string& inside, const std::string& more = {}) {
        return "<C:prop-filter name=\"" + name + "\"" + more + ">" + inside + "</C:prop-filter>";
    }
    static std::string text(const std::string& wanted, const std::string& attributes = {}) {
        return "<C:text-match" + attributes + ">" + wanted + "</C:text-match>";
    }

    BooksWorld world;
};

TEST_F(Queries, FindTextInEveryWay) {
    EXPECT_EQ(found(property("FN", text("may"))), (Names{"Bob", "Cem"}));
    EXPECT_EQ(found(property("fn", text("ÖZTÜRK"))), Names{"Ann"}) << "letters of any script without case";
    EXPECT_EQ(found(property("FN", text("ÖZTÜRK", " collation=\"i;ascii-casemap\""))), Names{});
    EXPECT_EQ(found(property("FN", text("may", " collation=\"i;octet\""))), Names{});
    EXPECT_EQ(found(property("FN", text("bob may", " match-type=\"equals\""))), Names{"Bob"});
    EXPECT_EQ(found(property("FN", text("bob", " match-type=\"starts-with\""))), Names{"Bob"});
    EXPECT_EQ(found(property("FN", text("may", " match-type=\"ends-with\""))), Names{"Bob"});
    EXPECT_EQ(found(property("FN", text("may", " negate-condition=\"yes\""))), Names{"Ann"});
    EXPECT_EQ(found(property("NOTE", text("comma, here"))), Names{"Ann"}) << "what the value says, not its escapes";
}

TEST_F(Queries, AskWhatIsThereAndWhatIsNot) {
    EXPECT_EQ(found(property("TEL", "")), (Names{"Ann", "Bob"}));
    EXPECT_EQ(found(property("TEL", "<C:is-not-defined/>")), Names{"Cem"});
    EXPECT_EQ(found(""), (Names{"Ann", "Bob", "Cem"})) << "a filter without conditions";
    EXPECT_EQ(query("").responses().size(), 3u) << "no filter";
}

TEST_F(Queries, JoinConditions) {
    const std::string may = property("FN", text("may")), phone = property("TEL", "");
    EXPECT_EQ(found(may + phone), (Names{"Ann", "Bob", "Cem"}));
    EXPECT_EQ(found(may + phone, " test=\"allof\""), Names{"Bob"});
    const std::string both = text("49 30") + text("30 1");
    EXPECT_EQ(found(property("TEL", text("49 30") + text("49 40"))), (Names{"Ann", "Bob"}));
    EXPECT_EQ(found(property("TEL", both, " test=\"allof\"")), Names{"Ann"});
}

TEST_F(Queries, LookIntoParameters) {
    const auto type = [](const std::string& inside) {
        return "<C:param-filter name=\"TYPE\">" + inside + "</C:param-filter>";
    };
    EXPECT_EQ(found(property("TEL", type(text("home")))), Names{"Ann"});
    EXPECT_EQ(found(property("TEL", type(text("home", " negate-condition=\"yes\"")))), Names{"Bob"});
    EXPECT_EQ(found(property("TEL", type(""))), (Names{"Ann", "Bob"}));
    EXPECT_EQ(found(property("TEL", type("<C:is-not-defined/>"))), Names{});
}

TEST_F(Queries, EndAtTheLimitThatIsAsked) {
    const auto answer = query("<C:filter/>", "<C:limit><C:nresults>2</C:nresults></C:limit>");
    const auto responses = answer.responses();
    ASSERT_EQ(responses.size(), 3u) << answer.body;
    EXPECT_EQ(responses[2].href, kContacts);
    EXPECT_EQ(responses[2].status, 507);
    EXPECT_THAT(responses[2].text, HasSubstr("number-of-matches-within-limits"));
    EXPECT_EQ(query("<C:filter/>", "<C:limit><C:nresults>3</C:nresults></C:limit>").responses().size(), 3u);
}

TEST_F(Queries, RefuseWhatTheyDoNotKnow) {
    const auto refused = [&](const std::string& filter, int status, const std::string& precondition) {
        const auto answer = query(filter);
        EXPECT_EQ(answer.status, status) << filter;
        EXPECT_EQ(answer.precondition(), precondition) << answer.body;
    };
    refused("<C:filter>" + property("FN", text("x", " collation=\"i;klingon\"")) + "</C:filter>", 403,
            "supported-collation");
    refused("<C:filter><C:comp-filter name=\"x\"/></C:filter>", 403, "supported-filter");
    refused("<C:filter>" + property("FN", "<C:sounds-like/>") + "</C:filter>", 403, "supported-filter");
    refused("<C:filter>" + property("", "") + "</C:filter>", 400, "");
    refused("<C:filter>" + property("FN", text("x", " match-type=\"sounds\"")) + "</C:filter>", 400, "");
    refused("<C:filter test=\"some\"/>", 400, "");
    std::string many;
    for (int i = 0; i < 200; ++i) many += property("FN", text("x"));
    refused("<C:filter>" + many + "</C:filter>", 403, "supported-filter");
}

} // namespace
} // namespace rolvane
