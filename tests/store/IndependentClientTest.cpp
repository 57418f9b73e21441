#include "StoreWorld.h"

#include <gtest/gtest.h>
#include <map>
#include <ne_auth.h>
#include <ne_basic.h>
#include <ne_props.h>
#include <ne_session.h>
#include <ne_ssl.h>
#include <ne_uri.h>

namespace rolvane {
namespace {

using namespace test;

// Another WebDAV client's view of one folder: decoded path -> entity tag; folders end in a slash.
std::map<std::string, std::string> viewOf(const StoreWorld& world, const std::string& path) {
    const Url base(world.store.baseURL());
    ne_session* session = ne_session_create("https", base.host().c_str(), static_cast<unsigned>(*base.port()));
    ne_ssl_certificate* authority = ne_ssl_cert_read(world.store.caFile().c_str());
    ne_ssl_trust_cert(session, authority);
    ne_add_server_auth(
        session, NE_AUTH_BASIC,
        [](void*, const char*, int attempt, char* user, char* password) {
            snprintf(user, NE_ABUFSIZ, "alice");
            snprintf(password, NE_ABUFSIZ, "wonder land");
            return attempt;
        },
        nullptr);
    std::map<std::string, std::string> out;
    const ne_propname wanted[] = {{"DAV:", "getetag"}, {nullptr, nullptr}};
    const int result = ne_simple_propfind(
        session, path.c_str(), NE_DEPTH_ONE, wanted,
        [](void* into, const ne_uri* uri, const ne_prop_result_set* results) {
            const ne_propname etag = {"DAV:", "getetag"};
            const char* value = ne_propset_value(results, &etag);
            char* decoded = ne_path_unescape(uri->path);
            (*static_cast<std::map<std::string, std::string>*>(into))[decoded] = value ? value : "";
            ne_free(decoded);
        },
        &out);
    EXPECT_EQ(result, NE_OK) << ne_get_error(session);
    ne_session_destroy(session);
    ne_ssl_cert_free(authority);
    return out;
}

TEST(IndependentClient, SeesTheTreeAsOurListingDoes) {
    StoreWorld world;
    Client alice(world);
    ASSERT_TRUE(alice.manager.sanityCheckPublishStructureCreate(true));
    const std::vector<std::string> names = {"People/0/\xC3\x84 & <b>:CXPerson", "People/31/50%25:CXPerson",
                                            "G 1:CXGroup", "\xE5\xAE\xB6\xE6\x97\x8F:CXGroup"};
    for (const auto& n : names) ASSERT_EQ(alice.write(n, Dictionary{{"n", n}}), 201) << n;
    ASSERT_TRUE(alice.manager.createDirectoryAtAURL(alice.at("G 1:CXGroup")));

    const auto ours = alice.manager.infoForFilesInContainer(alice.base);
    ASSERT_TRUE(ours);
    std::map<std::string, std::string> theirs;
    for (const std::string folder : {"", "People/0/", "People/31/", "G%201%3ACXGroup/"})
        for (const auto& [path, tag] : viewOf(world, "/dav/alice/Contacts/" + folder)) theirs[path] = tag;
    for (const auto& n : names) {
        const std::string path = "/alice/Contacts/" + n;
        ASSERT_TRUE(ours->contains(path)) << path;
        const bool folder = n == "G 1:CXGroup";
        const std::string there = "/dav" + path + (folder ? "/.state" : "");
        ASSERT_TRUE(theirs.contains(there)) << there;
        EXPECT_EQ(ours->at(path).etag.str(), theirs.at(there)) << path;
        EXPECT_EQ(ours->at(path).isCollection, folder);
        EXPECT_TRUE(ours->at(path).modificationdate) << path;
    }
    size_t files = 0;
    for (const auto& [path, info] : *ours) files += !info.isCollection;
    EXPECT_EQ(files, names.size() - 1 + 2) << "the written ones, info and dateFile; nothing of the bookkeeping";
}

} // namespace
} // namespace rolvane
