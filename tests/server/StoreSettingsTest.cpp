#include "server/StoreSettings.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "server/StoreConfiguration.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

std::string complaintAbout(const std::string& text) {
    try {
        withStoreSettings({}, text);
    } catch (const CXException& error) {
        return error.reason();
    }
    return {};
}

TEST(StoreSettings, NeedANameAndWhomTheAuthorityMayWriteTo) {
    const auto o = withStoreSettings({}, "# comment\n\n  name =  dav.example.org \nacme-contact = x@y\n");
    EXPECT_EQ(o.name, "dav.example.org");
    EXPECT_EQ(o.port, 443);
    EXPECT_EQ(o.acmeDirectory, "https://acme-v02.api.letsencrypt.org/directory");
    EXPECT_EQ(o.quota, "none");
    EXPECT_TRUE(o.slowsGuesses);
    EXPECT_EQ(o.hosts, (std::vector<std::string>{"dav.example.org", "localhost", "127.0.0.1", "::1"}));
    EXPECT_THAT(complaintAbout("port = 443\n"), HasSubstr("name = dav.example.org"));
    EXPECT_THAT(complaintAbout("name = dav.example.org\n"), HasSubstr("acme-contact"));
    EXPECT_EQ(complaintAbout("name = dav.example.org\ncertificate = own\n"), "");
}

TEST(StoreSettings, TakeWhatIsWrittenAndForgetWhatIsNot) {
    auto o =
        withStoreSettings({}, "name=a.b\nport=8443\ncertificate=/x/c.pem\nkey=/x/k.pem\nquota=2G\naccess-log=on\n");
    EXPECT_EQ(o.port, 8443);
    EXPECT_EQ(o.certificate, "/x/c.pem");
    EXPECT_EQ(o.certificateKey, "/x/k.pem");
    EXPECT_EQ(o.acmeDirectory, "");
    EXPECT_EQ(o.quota, "2G");
    EXPECT_TRUE(o.accessLog);
    o = withStoreSettings(o, "name=a.b\ncertificate=own\n");
    EXPECT_EQ(o.port, 443);
    EXPECT_EQ(o.certificate + o.certificateKey + o.acmeDirectory, "");
    EXPECT_EQ(o.quota, "none");
    EXPECT_FALSE(o.accessLog);
}

TEST(StoreSettings, NameTheLineThatCannotBeUsed) {
    const std::pair<const char*, const char*> wrong[] = {
        {"nonsense\n", "Line 2"},
        {"colour = red\n", "colour = red"},
        {"port = 0\n", "port"},
        {"port = 99999\n", "port"},
        {"port = 1x\n", "port"},
        {"quota = 5Q\n", "quota"},
        {"quota = \n", "quota"},
        {"access-log = yes\n", "access-log"},
        {"certificate = c.pem\n", "certificate"},
        {"certificate = /c.pem\n", "key"},
        {"key = /k.pem\n", "key"},
        {"certificate = /a\"b\nkey = /k\n", "certificate"},
        {"certificate = own\nacme-contact = a@b\n", "acme-contact"},
        {"acme-directory = https://a/\" b\n", "acme-directory"},
        {"name = a b\n", "name"},
        {"name = a\"b\n", "name"},
    };
    for (const auto& [line, part] : wrong)
        EXPECT_THAT(complaintAbout(std::string("name = dav.example.org\n") + line), HasSubstr(part)) << line;
}

TEST(StoreSettings, MakeAConfigurationThatListensEverywhereAndSlowsGuesses) {
    auto o = withStoreSettings({}, "name = dav.example.org\nacme-contact = x@y\nquota = 1G\n");
    o.stateDirectory = "/state";
    o.documentRoot = "/root";
    const std::string text = renderStoreConfiguration(readFile(storeTemplatePath()), o, 443, true);
    for (const char* part : {"\nListen 443\n", "\nServerName dav.example.org\n", "Define SLOWGUESSES", "Define ACME\n",
                             "Define QUOTA", "DavAclQuota 1G", "MDomain dav.example.org", "acme-tls/1"})
        EXPECT_THAT(text, HasSubstr(part));
    EXPECT_THAT(text, Not(HasSubstr("Listen 127.0.0.1")));
    o = withStoreSettings(o, "name = dav.example.org\ncertificate = /x/c.pem\nkey = /x/k.pem\n");
    const std::string files = renderStoreConfiguration(readFile(storeTemplatePath()), o, 443, true);
    EXPECT_THAT(files, HasSubstr("SSLCertificateFile \"/x/c.pem\""));
    EXPECT_THAT(files, HasSubstr("SSLCertificateKeyFile \"/x/k.pem\""));
    EXPECT_THAT(files, Not(HasSubstr("Define ACME\n")));
}

TEST(StoreSettings, AreKeptFromOneStartToTheNext) {
    const auto o = withStoreSettings({}, "name = a.b\nacme-contact = x@y\nacme-authority = /ca\nquota = 1G\n");
    const auto kept = storeOptionsFromDictionary(storeOptionsToDictionary(o, 443));
    EXPECT_EQ(kept.name, o.name);
    EXPECT_EQ(kept.acmeDirectory, o.acmeDirectory);
    EXPECT_EQ(kept.acmeContact, o.acmeContact);
    EXPECT_EQ(kept.acmeAuthority, o.acmeAuthority);
    EXPECT_EQ(kept.quota, o.quota);
    EXPECT_TRUE(kept.slowsGuesses);
}

} // namespace
} // namespace rolvane
