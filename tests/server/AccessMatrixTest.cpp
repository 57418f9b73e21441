#include "AccessMatrix.h"
#include "AccessWorld.h"
#include "foundation/Paths.h"

#include <algorithm>
#include <cstdlib>
#include <gtest/gtest.h>
#include <tuple>

namespace rolvane {
namespace {

const std::string kLockedCollection = "/dav/alice/Contacts/locked/";

std::string lockTokenOf(const RawAnswer& answer) {
    const size_t at = answer.headers.find("<opaquelocktoken");
    return at == std::string::npos ? "" : answer.headers.substr(at, answer.headers.find('>', at) + 1 - at);
}

// The tree as it should be before each request.
class MatrixWorld : public AccessWorld {
public:
    using AccessWorld::AccessWorld;
    void prepare(bool withLock) {
        releaseLock();
        reset();
        if (withLock) _token = lockTokenOf(ask("alice", "LOCK", kLockedCollection, {}, kLock));
    }
    void releaseLock() {
        if (!_token.empty()) ask("alice", "UNLOCK", kLockedCollection, {{"Lock-Token", _token}});
        _token.clear();
    }
    // One request of the matrix.
    RawAnswer perform(const AccessRow& row, const AccessPlace& place, const std::string& who) const {
        const std::string method = row.method;
        const std::string home = "/dav/" + (who.empty() ? "sam" : who);
        if (method == "COPY to" || method == "MOVE to")
            return ask(who, method.substr(0, 4), home + "/own", {{"Destination", place.path}});
        if (method == "COPY from" || method == "MOVE from")
            return ask(who, method.substr(0, 4), place.path, {{"Destination", home + "/copy"}});
        std::vector<std::pair<std::string, std::string>> headers;
        if (method == "PROPFIND") headers = {{"Depth", "0"}};
        return ask(who, method, place.path, headers, bodyOf(method));
    }

private:
    static std::string bodyOf(const std::string& method) {
        if (method == "PUT" || method == "POST") return "changed";
        if (method == "PROPPATCH") return kPatch;
        if (method == "LOCK") return kLock;
        if (method == "ACL") return lists();
        if (method == "REPORT") return "<x xmlns=\"urn:x\"/>";
        return {};
    }
    std::string _token;
};

class AccessMatrix : public testing::TestWithParam<std::tuple<AccessVariant, size_t>> {
protected:
    static void TearDownTestSuite() { world.reset(); }
    void SetUp() override {
        const AccessVariant variant = std::get<0>(GetParam());
        if (world && world->variant == variant) return;
        world.reset();
        world = std::make_unique<MatrixWorld>(variant);
    }
    static std::unique_ptr<MatrixWorld> world;
};
std::unique_ptr<MatrixWorld> AccessMatrix::world;

TEST_P(AccessMatrix, AnswersAsWrittenDown) {
    const AccessPlace& place = kAccessPlaces[std::get<1>(GetParam())];
    const bool locked = std::string(place.name) == "locked file";
    world->prepare(locked);
    for (const AccessRow& row : kAccessMatrix) {
        if (row.place != std::string(place.name)) continue;
        const std::pair<const char*, int> cells[] = {{"alice", row.owner},  {"walter", row.writer},
                                                     {"rita", row.reader},  {"greta", row.member},
                                                     {"sam", row.stranger}, {"", row.anonymous}};
        for (const auto& [who, expected] : cells) {
            const RawAnswer answer = world->perform(row, place, who);
            EXPECT_EQ(answer.status, expected) << row.method << " " << place.path << " by " << who << "\n"
                                               << answer.body;
            const std::string token = lockTokenOf(answer);
            if (!token.empty()) world->ask(who, "UNLOCK", place.path, {{"Lock-Token", token}});
            const bool reads = std::string(row.method) == "GET" || std::string(row.method) == "HEAD" ||
                               std::string(row.method) == "OPTIONS" || std::string(row.method) == "PROPFIND";
            if (answer.status / 100 == 2 && !reads) world->prepare(locked);
        }
    }
    world->releaseLock();
}

std::string nameOfRun(const testing::TestParamInfo<std::tuple<AccessVariant, size_t>>& run) {
    constexpr const char* kVariants[] = {"", "ByDbm", "ByDigest", "WithSanitizers"};
    std::string name = kAccessPlaces[std::get<1>(run.param)].name;
    std::erase(name, ' ');
    return name + kVariants[static_cast<int>(std::get<0>(run.param))];
}

INSTANTIATE_TEST_SUITE_P(Places, AccessMatrix,
                         testing::Combine(testing::Values(AccessVariant::usual, AccessVariant::digest,
                                                          AccessVariant::sanitized),
                                          testing::Range<size_t>(0, kAccessPlaces.size())),
                         nameOfRun);
// Another provider changes who is known, and nothing of what they may do.
INSTANTIATE_TEST_SUITE_P(FirstPlaces, AccessMatrix,
                         testing::Combine(testing::Values(AccessVariant::dbm), testing::Range<size_t>(0, 3)),
                         nameOfRun);

TEST(AccessListsByDbm, NameWhomTheProviderKnowsAndNobodyElse) {
    const AccessWorld world(AccessVariant::dbm);
    world.reset();
    using W = AccessWorld;
    const std::string tree = "/dav/alice/Contacts/";
    EXPECT_EQ(world.status("alice", "ACL", tree, {}, W::acl(W::ace(W::user("rita"), "read"))), 200);
    EXPECT_EQ(world.status("rita", "GET", tree + "dateFile"), 200);
    EXPECT_EQ(world.status("walter", "GET", tree + "dateFile"), 403);
    EXPECT_EQ(world.status("nobody", "GET", tree + "dateFile"), 401);
    EXPECT_EQ(world.ask("alice", "ACL", tree, {}, W::acl(W::ace(W::user("nobody"), "read"))).precondition(),
              "recognized-principal");
    EXPECT_EQ(world.status("sam", "PROPFIND", "/principals/users/greta", {{"Depth", "0"}}), 207);
    EXPECT_EQ(world.status("sam", "PROPFIND", "/principals/users/nobody", {{"Depth", "0"}}), 404);
}

TEST(AccessMatrixDocument, IsThatOfTheTests) {
    const std::string path = ROLVANE_SOURCE_DIR "/docs/access-matrix.md";
    if (std::getenv("ROLVANE_UPDATE_DOCS")) writeFileDurably(path, accessMatrixDocument(), 0644);
    EXPECT_EQ(readFile(path), accessMatrixDocument()) << "run this test with ROLVANE_UPDATE_DOCS=1";
}

TEST(AccessMatrixDocument, SpeaksOfEveryMethodAtEveryPlace) {
    std::vector<std::string> seen;
    for (const AccessRow& row : kAccessMatrix) seen.push_back(std::string(row.method) + " " + row.place);
    std::sort(seen.begin(), seen.end());
    EXPECT_EQ(std::adjacent_find(seen.begin(), seen.end()), seen.end());
    EXPECT_EQ(seen.size() % kAccessPlaces.size(), 0u);
}

} // namespace
} // namespace rolvane
