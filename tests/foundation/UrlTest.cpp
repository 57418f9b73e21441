#include "foundation/Url.h"

#include "foundation/CXException.h"

#include "Generators.h"

#include <gtest/gtest.h>
#include <rapidcheck/gtest.h>

namespace rolvane {
namespace {

using Components = std::vector<std::string>;

std::string appended(const std::string& url, std::string_view component) {
    return Url(url).cxURLByAppendingComponent(component).absoluteString();
}
std::string shortened(const std::string& url) {
    return Url(url).cxURLByDeletingLastComponent().absoluteString();
}

TEST(UrlTest, KeepsTheTextThatItWasParsedFrom) {
    for (const char* text : {"http://host/user/Contacts", "HTTP://Host:8080/a%2fb/?q=1#f", "file:/usr/share/rolvane/",
                             "mailto:a@b", "https://u:p@[::1]:8443/", "http://host", "x-y+z.1:", "file:///tmp"})
        EXPECT_EQ(Url(text).absoluteString(), text);
}

TEST(UrlTest, RefusesTextThatIsNoUrl) {
    for (const char* bad : {"",
                            "local",
                            "/path",
                            "1http://h/",
                            "http//h",
                            ":x",
                            "http://h/a b",
                            "http://h/a\nb",
                            "http://h/\xc3\xa9",
                            "http://h/%",
                            "http://h/%2",
                            "http://h/%zz",
                            "http://h:x/",
                            "http://h:65536/",
                            "http://[::1/",
                            "http://[gg]/",
                            "http://a@b@c/",
                            "http:///path",
                            "http:path",
                            "https://:80/",
                            "http://user@/",
                            "http://h/<a>",
                            "http://h/a\\b",
                            "http://h]x/",
                            "http://h/a[b]"})
        EXPECT_EQ(Url::parse(bad), std::nullopt) << bad;
    EXPECT_EQ(Url::parse(std::string_view("http://h/\0", 10)), std::nullopt);
    try {
        Url("no url");
        ADD_FAILURE() << "nothing was thrown";
    } catch (const CXException& e) {
        EXPECT_EQ(e.name(), kCXInvalidArgumentException);
        EXPECT_NE(e.reason().find("\"no url\""), std::string::npos);
    }
}

TEST(UrlTest, GivesItsParts) {
    const Url u("HTTPS://User:pw@Dav.Example.ORG:8443/a%20b/c?q#f");
    EXPECT_EQ(u.scheme(), "HTTPS");
    EXPECT_EQ(u.host(), "Dav.Example.ORG");
    EXPECT_EQ(u.port(), 8443);
    EXPECT_EQ(u.origin(), "https://dav.example.org:8443");
    EXPECT_EQ(u.encodedPath(), "/a%20b/c");
    EXPECT_EQ(u.path(), "/a b/c");
    EXPECT_EQ(Url("http://h").encodedPath(), "");
    EXPECT_EQ(Url("http://h?q/r").encodedPath(), "");
    EXPECT_EQ(Url("http://h?q/r").host(), "h");
    EXPECT_EQ(Url().scheme(), "");
    EXPECT_EQ(Url().pathComponents(), Components{});
}

TEST(UrlTest, MakesTheDefaultPortOfAnOriginExplicit) {
    EXPECT_EQ(Url("http://h/x").origin(), "http://h:80");
    EXPECT_EQ(Url("https://h:/x").origin(), "https://h:443");
    EXPECT_EQ(Url("https://h/x").origin(), Url("HTTPS://H:443").origin());
    EXPECT_NE(Url("https://h/x").origin(), Url("http://h/x").origin());
    EXPECT_EQ(Url("http://[FE80::1]/").origin(), "http://[fe80::1]:80");
    EXPECT_EQ(Url("http://[FE80::1]/").host(), "FE80::1");
    EXPECT_EQ(Url("http://[::1]").port(), std::nullopt);
}

TEST(UrlTest, GivesDecodedComponentsWithTheRootFirst) {
    EXPECT_EQ(Url("http://host/user/Contacts").pathComponents(), (Components{"/", "user", "Contacts"}));
    EXPECT_EQ(Url("file:/usr/share/rolvane/U").pathComponents(), (Components{"/", "usr", "share", "rolvane", "U"}));
    EXPECT_EQ(Url("http://host//a///b%2Fc/").pathComponents(), (Components{"/", "a", "b/c"}));
    EXPECT_EQ(Url("http://host/").pathComponents(), (Components{"/"}));
    EXPECT_EQ(Url("http://host").pathComponents(), Components{});
    EXPECT_EQ(Url("mailto:a/b").pathComponents(), (Components{"a", "b"}));
}

TEST(UrlTest, GivesTheLastComponent) {
    EXPECT_EQ(Url("http://host/user/Contacts").cxLastComponent(), "Contacts");
    EXPECT_EQ(Url("http://host/user/Contacts//").cxLastComponent(), "Contacts");
    EXPECT_EQ(Url("http://host/a%2Fb?q=/z").cxLastComponent(), "a/b");
    EXPECT_EQ(Url("http://host/").cxLastComponent(), "");
    EXPECT_EQ(Url("http://host").cxLastComponent(), "");
    EXPECT_EQ(Url("mailto:x").cxLastComponent(), "x");
}

TEST(UrlTest, AppendsAComponentWithOneSlashBetween) {
    EXPECT_EQ(appended("file:/usr/share/rolvane/", "U"), "file:/usr/share/rolvane/U");
    EXPECT_EQ(appended("file:/usr/share/rolvane", "U"), "file:/usr/share/rolvane/U");
    EXPECT_EQ(appended("http://host/a//", "b"), "http://host/a/b");
    EXPECT_EQ(appended("http://host", "b"), "http://host/b");
    EXPECT_EQ(appended("http://host/", "b"), "http://host/b");
    EXPECT_EQ(appended("file:/", "b"), "file:/b");
    EXPECT_EQ(appended("http://host/a?q#f", "b"), "http://host/a/b");
}

TEST(UrlTest, AHostileComponentStaysOneComponent) {
    EXPECT_EQ(appended("http://h/u", ".."), "http://h/u/%2E%2E");
    EXPECT_EQ(appended("http://h/u", "."), "http://h/u/%2E");
    EXPECT_EQ(appended("http://h/u", "../"), "http://h/u/..%2F");
    EXPECT_EQ(appended("http://h/u", "a/b"), "http://h/u/a%2Fb");
    EXPECT_EQ(appended("http://h/u", "?q#f"), "http://h/u/%3Fq%23f");
    EXPECT_EQ(appended("http://h/u", "%2F"), "http://h/u/%252F");
    EXPECT_EQ(appended("http://h/u", "a\r\nb"), "http://h/u/a%0D%0Ab");
    EXPECT_EQ(appended("http://h/u", "\xc3\xa9"), "http://h/u/%C3%A9");
    EXPECT_EQ(appended("http://h/u", std::string_view("\0", 1)), "http://h/u/%00");
    EXPECT_EQ(appended("http://h/u", "1:CXPerson"), "http://h/u/1%3ACXPerson");
}

TEST(UrlTest, RefusesToAppendNothing) {
    EXPECT_THROW(Url("http://h/u").cxURLByAppendingComponent(""), CXException);
    EXPECT_THROW(Url().cxURLByAppendingComponent("x"), CXException);
}

RC_GTEST_PROP(UrlTest, AnyComponentComesBackAsTheLastOne, ()) {
    const std::string base =
        *rc::gen::element<std::string>("http://h", "http://h/", "http://h/a", "file:/a/b/", "https://h:1/a%2Fb?q");
    const std::string component = *rc::gen::suchThat(test::anyText(), [](const std::string& s) { return !s.empty(); });
    const Url url = Url(base).cxURLByAppendingComponent(component);
    RC_ASSERT(Url::parse(url.absoluteString()) == url);
    RC_ASSERT(url.cxLastComponent() == component);
    RC_ASSERT(url.pathComponents().size() == std::max<size_t>(Url(base).pathComponents().size(), 1) + 1);
    RC_ASSERT(url.encodedPath().find("//") == std::string::npos);
    RC_ASSERT(url.origin() == Url(base).origin());
}

TEST(UrlTest, DeletesTheLastComponentDownToTheRoot) {
    EXPECT_EQ(shortened("http://host/user/Contacts"), "http://host/user");
    EXPECT_EQ(shortened("http://host/user/Contacts/"), "http://host/user");
    EXPECT_EQ(shortened("http://host/user//Contacts?q"), "http://host/user");
    EXPECT_EQ(shortened("http://host/user"), "http://host/");
    EXPECT_EQ(shortened("http://host/"), "http://host/");
    EXPECT_EQ(shortened("http://host"), "http://host");
    EXPECT_EQ(shortened("file:/a"), "file:/");
    EXPECT_EQ(shortened("file:////a"), "file:///");
    EXPECT_EQ(shortened("mailto:x"), "mailto:");
}

TEST(UrlTest, ReplacesTheScheme) {
    EXPECT_EQ(Url("http://h:8080/a?q").withScheme("https").absoluteString(), "https://h:8080/a?q");
    EXPECT_THROW(Url("http://h/").withScheme("no scheme"), CXException);
    EXPECT_THROW(Url().withScheme("http"), CXException);
}

TEST(UrlTest, MakesAFileUrlOfAPathAndGivesThePathBack) {
    EXPECT_EQ(Url::fileURL("/usr/share/rolvane").absoluteString(), "file:/usr/share/rolvane");
    EXPECT_EQ(Url::fileURL("/tmp//a b/\xc3\xa9/").absoluteString(), "file:/tmp/a%20b/%C3%A9/");
    EXPECT_EQ(Url::fileURL("/").absoluteString(), "file:/");
    EXPECT_EQ(Url::fileURL("/tmp/a b?#%").filePath(), "/tmp/a b?#%");
    EXPECT_EQ(Url::fileURL("/").filePath(), "/");
    EXPECT_EQ(Url("file:///tmp/x").filePath(), "/tmp/x");
    EXPECT_EQ(Url("FILE://LocalHost/tmp/x").filePath(), "/tmp/x");
    EXPECT_THROW(Url::fileURL("tmp"), CXException);
    EXPECT_THROW(Url::fileURL(""), CXException);
}

TEST(UrlTest, NoNameLeavesItsDirectoryOnTheWayToAFilePath) {
    const Url base("file:/usr/share/rolvane/");
    for (const std::string& name :
         {std::string(".."), std::string("."), std::string("a/b"), std::string("../../etc"), std::string("a\0b", 3)})
        EXPECT_THROW(base.cxURLByAppendingComponent(name).filePath(), CXException) << name;
    EXPECT_EQ(base.cxURLByAppendingComponent("...").filePath(), "/usr/share/rolvane/...");
    for (const char* bad : {"http://h/x", "file://other/x", "file:x", "file:", "file:/a/../b", "file:/a/%2e%2E/b"})
        EXPECT_THROW(Url(bad).filePath(), CXException) << bad;
}

TEST(UrlTest, DecodesEscapesAndLeavesMalformedOnes) {
    EXPECT_EQ(Url::percentDecode("a%20b%C3%a9%2"), "a b\xc3\xa9%2");
    EXPECT_EQ(Url::percentDecode("100%"), "100%");
    EXPECT_EQ(Url::percentDecode("%zz%4"), "%zz%4");
    EXPECT_EQ(Url::percentEncodeComponent("Az09-._~ /"), "Az09-._~%20%2F");
}

RC_GTEST_PROP(UrlTest, ParsingNeverThrowsAndEveryOperationOnWhatPassesHolds, ()) {
    const auto alphabet = rc::gen::element('a', '/', ':', '@', '[', ']', '?', '#', '%', '2', 'F', '.', ' ');
    const std::string text =
        *rc::gen::element<std::string>("", "http:", "http://h", "file:") + *rc::gen::container<std::string>(alphabet);
    const auto url = Url::parse(text);
    if (!url) return;
    RC_ASSERT(url->absoluteString() == text);
    RC_ASSERT(Url::parse(url->cxURLByDeletingLastComponent().absoluteString()).has_value());
    Url u = *url;
    for (size_t i = 0; i <= text.size(); ++i) u = u.cxURLByDeletingLastComponent();
    RC_ASSERT(u.cxLastComponent().empty());
}

} // namespace
} // namespace rolvane
