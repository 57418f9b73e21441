#include "server/StoreConfiguration.h"

#include "foundation/CXException.h"
#include "foundation/Paths.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

PrivateStoreOptions options() {
    PrivateStoreOptions o;
    o.stateDirectory = "/state";
    o.documentRoot = "/root";
    return o;
}

TEST(StoreConfiguration, FillsInEveryNameOfTheTemplate) {
    const std::string text = renderStoreConfiguration(readFile(storeTemplatePath()), options(), 8443, true);
    EXPECT_THAT(text, Not(testing::ContainsRegex("@[A-Z_]+@")));
    EXPECT_THAT(text, HasSubstr("Listen 127.0.0.1:8443\nListen [::1]:8443\n"));
    EXPECT_THAT(text, HasSubstr("AllowOverride None"));
}

TEST(StoreConfiguration, ListensOnTheLoopbackAddressesAlone) {
    const std::string text = renderStoreConfiguration(readFile(storeTemplatePath()), options(), 8443, false);
    EXPECT_THAT(text, HasSubstr("Listen 127.0.0.1:8443\n"));
    size_t count = 0;
    for (size_t at = text.find("\nListen "); at != std::string::npos; at = text.find("\nListen ", at + 1)) ++count;
    EXPECT_EQ(count, 1u);
}

TEST(StoreConfiguration, PutsValuesInOnceAndDoesNotReadThemAgain) {
    PrivateStoreOptions o = options();
    o.extraConfiguration = {"# @STATE@ me@example.org"};
    EXPECT_EQ(
        renderStoreConfiguration("a@b @LISTEN@\n@EXTRA@", o, 1, false),
        "Define TLS\nDefine HTTP2\nDefine BASIC\nDefine DAVACL\nDefine ACCESSLISTS\na@b Listen 127.0.0.1:1\n# @STATE@ "
        "me@example.org\n");
}

TEST(StoreConfiguration, RefusesWhatWouldEscapeFromItsQuotationMarks) {
    for (const char* path : {"/a\"b", "/a\nb", "/a\\b", "/${HOME}", "relative", ""}) {
        PrivateStoreOptions o = options();
        o.documentRoot = path;
        EXPECT_THROW(renderStoreConfiguration("", o, 1, false), CXException) << path;
    }
    PrivateStoreOptions o = options();
    o.logLevel = "warn\nUser root";
    EXPECT_THROW(renderStoreConfiguration("", o, 1, false), CXException);
}

TEST(StoreConfiguration, OpensEachTreeToItsUserByASectionOfItsOwn) {
    EXPECT_EQ(renderStoreUsers("/root/dav", {"alice", "bob"}, StoreAuthentication::basic, false),
              "<Directory \"/root/dav/alice\">\n  Require user alice\n</Directory>\n"
              "<Directory \"/root/dav/bob\">\n  Require user bob\n</Directory>\n");
}

TEST(StoreConfiguration, OptionsSurviveBeingKept) {
    PrivateStoreOptions o = options();
    o.tls = false;
    o.http2 = false;
    o.authentication = StoreAuthentication::digest;
    o.hosts = {"localhost"};
    o.threadsPerProcess = 7;
    o.maximumKeepAliveRequests = 100;
    o.logLevel = "info";
    o.accessLog = true;
    o.extraConfiguration = {"Timeout 5", "# two"};
    const Dictionary kept = storeOptionsToDictionary(o, 4711);
    const PrivateStoreOptions back = storeOptionsFromDictionary(kept);
    EXPECT_EQ(back.port, 4711);
    EXPECT_EQ(back.extraConfiguration, o.extraConfiguration);
    EXPECT_TRUE(storeOptionsToDictionary(back, 4711) == kept);
}

TEST(StoreConfiguration, TakesTheThreadsOfToday) {
    Dictionary kept;
    kept.set("threadsPerProcess", 32); // every store that an earlier version started
    EXPECT_EQ(storeOptionsFromDictionary(kept).threadsPerProcess, PrivateStoreOptions().threadsPerProcess);
}

TEST(StoreConfiguration, WhatIsMissingTakesItsDefault) {
    EXPECT_TRUE(storeOptionsToDictionary(storeOptionsFromDictionary(Dictionary()), 0) ==
                storeOptionsToDictionary(PrivateStoreOptions(), 0));
}

} // namespace
} // namespace rolvane
