#include "StoreTestWorld.h"

#include "foundation/Paths.h"
#include "server/StoreConfiguration.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

namespace rolvane {
namespace {

using testing::HasSubstr;

// A stock httpd that reads a configuration with the module and the given lines, and says what it thinks of them.
class AccessConfiguration : public testing::Test {
protected:
    AccessConfiguration() {
        for (const char* name : {"/lists", "/root", "/run"}) mkdir((directory.path() + name).c_str(), 0700);
    }
    CommandResult check(const std::string& lines) {
        const std::string modules = PrivateStoreOptions().httpdModules;
        std::string text = "ServerRoot \"" + directory.path() + "\"\nServerName localhost\nListen 127.0.0.1:9\n" +
                           "PidFile run/pid\nErrorLog /dev/stderr\nDocumentRoot \"" + directory.path("root") + "\"\n";
        for (const char* name : {"mpm_event", "authn_core", "authn_file", "authz_core", "dav", "dav_fs"})
            text += std::string("LoadModule ") + name + "_module " + modules + "/mod_" + name + ".so\n";
        text += "LoadModule davacl_module \"" + storeAccessModulePath(modules) + "\"\n" + lines;
        writeFileDurably(directory.path("httpd.conf"), text);
        return runCommand({PrivateStoreOptions().httpdProgram, "-t", "-f", directory.path("httpd.conf")});
    }
    std::string complaint(const std::string& lines) {
        const CommandResult result = check(lines);
        EXPECT_NE(result.status, 0) << lines;
        return result.errors;
    }
    std::string base() const { return "DavAclBase /dav \"" + directory.path("lists") + "\"\n"; }

    StoreDirectory directory;
};

TEST_F(AccessConfiguration, OfThePageForAdministratorsIsTaken) {
    const CommandResult result = check(base() + "DavAclUsers file\nDavAclGroupFile groups\nDavAclDepth 3\n"
                                                "DavAclPrincipals /people\n");
    EXPECT_EQ(result.status, 0) << result.errors;
    EXPECT_EQ(check("").status, 0) << "loaded and not used";
}

TEST_F(AccessConfiguration, SaysWhatIsWrongWithADirective) {
    const std::string lists = " \"" + directory.path("lists") + "\"\n";
    EXPECT_THAT(complaint("DavAclBase dav" + lists), HasSubstr("must be a URL path"));
    EXPECT_THAT(complaint("DavAclBase /" + lists), HasSubstr("must be a URL path"));
    EXPECT_THAT(complaint("DavAclBase /a/../b" + lists), HasSubstr("must be a URL path"));
    EXPECT_THAT(complaint("DavAclBase /a%20b" + lists), HasSubstr("must be a URL path"));
    EXPECT_THAT(complaint("DavAclBase /dav \"" + directory.path("none") + "\"\n"), HasSubstr("is not there: make it"));
    EXPECT_THAT(complaint(base() + base()), HasSubstr("may stand once"));
    EXPECT_THAT(complaint(base() + "DavAclUsers nowhere\n"), HasSubstr("no authentication provider called nowhere"));
    EXPECT_THAT(complaint(base() + "DavAclDepth 0\n"), HasSubstr("from 1 to 8"));
    EXPECT_THAT(complaint(base() + "DavAclDepth two\n"), HasSubstr("from 1 to 8"));
    EXPECT_THAT(complaint("<Location /dav>\n" + base() + "</Location>\n"), HasSubstr("not allowed"));
    chmod(directory.path("lists").c_str(), 0770);
    EXPECT_THAT(complaint(base()), HasSubstr("may be written by others"));
}

} // namespace
} // namespace rolvane
