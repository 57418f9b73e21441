#include "server/BooksConfiguration.h"
#include "StoreTestWorld.h"
#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "server/BooksDevices.h"
#include "support/UnitExposure.h"

#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <set>
#include <sys/stat.h>

namespace rolvane {
namespace {

using testing::HasSubstr;
using testing::Not;

BooksOptions someBooks(const std::string& directory = "/home/ada/.local/state/rolvane/books") {
    BooksOptions options;
    options.stateDirectory = directory;
    options.database = "/home/ada/.local/share/rolvane/contacts.db";
    options.cardbookModule = "/usr/lib/apache2/modules/mod_cardbook.so";
    return options;
}

std::set<std::string> linesThatBeginWith(const std::string& text, const std::string& start) {
    std::set<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);)
        if (line.starts_with(start)) lines.insert(line);
    return lines;
}

TEST(BooksConfiguration, ListensOnLoopbackAndOnTheAddressThatIsAskedFor) {
    const auto listens = [](const std::string& address, bool ipv6, int inner = 0) {
        BooksOptions options = someBooks();
        options.listen = address;
        return linesThatBeginWith(renderBooksConfiguration(options, 4711, inner, ipv6), "Listen ");
    };
    using Lines = std::set<std::string>;
    EXPECT_EQ(listens("", true), (Lines{"Listen 127.0.0.1:4711", "Listen [::1]:4711"}));
    EXPECT_EQ(listens("", false), Lines{"Listen 127.0.0.1:4711"});
    EXPECT_EQ(listens("192.168.1.20", true),
              (Lines{"Listen 127.0.0.1:4711", "Listen [::1]:4711", "Listen 192.168.1.20:4711"}));
    EXPECT_EQ(listens("0.0.0.0", true), (Lines{"Listen 0.0.0.0:4711", "Listen [::1]:4711"}));
    EXPECT_EQ(listens("::", true), (Lines{"Listen 127.0.0.1:4711", "Listen [::]:4711"}));
    EXPECT_EQ(listens("192.168.1.20", true, 5000), Lines{"Listen 127.0.0.1:5000"}) << "behind a socket unit";
}

TEST(BooksConfiguration, HasNoPlaceWithoutAPassword) {
    const std::string text = renderBooksConfiguration(someBooks(), 4711, 0, true);
    EXPECT_THAT(text, HasSubstr("<Location \"/books\">\n  Dav cardbook\n  AuthType Basic\n"));
    EXPECT_EQ(linesThatBeginWith(text, "  Require "),
              (std::set<std::string>{"  Require all denied", "  Require valid-user"}));
    EXPECT_THAT(text, HasSubstr("DavAclSlowGuesses On"));
    EXPECT_THAT(text, HasSubstr("CardBookDatabase \"/home/ada/.local/share/rolvane/contacts.db\""));
    EXPECT_THAT(text, Not(HasSubstr("@")));
}

TEST(BooksConfiguration, TakesNoPathThatWouldEndItsLine) {
    BooksOptions options = someBooks();
    options.database = "/tmp/a\"\nRequire all granted";
    EXPECT_THROW(renderBooksConfiguration(options, 4711, 0, true), CXException);
    options = someBooks("/tmp/${HOME}");
    EXPECT_THROW(renderBooksConfiguration(options, 4711, 0, true), CXException);
    options = someBooks();
    options.logLevel = "warn\nDefine X";
    EXPECT_THROW(renderBooksConfiguration(options, 4711, 0, true), CXException);
}

TEST(BooksConfiguration, IsKeptFromOneStartToTheNext) {
    BooksOptions options = someBooks();
    options.tls = false;
    options.listen = "192.168.1.20";
    options.hosts = {"ada.example.org"};
    options.maximumCard = 5000000000;
    options.threads = 7;
    options.accessLog = true;
    options.extraConfiguration = {"LogLevel debug"};
    const Dictionary kept = booksOptionsToDictionary(options, 4711, 5000);
    const BooksOptions read = booksOptionsFromDictionary(kept);
    EXPECT_EQ(booksOptionsToDictionary(read, 4711, 5000), kept);
    EXPECT_EQ(read.port, 4711);
    EXPECT_EQ(read.hosts, options.hosts);
    EXPECT_FALSE(read.tls);
    EXPECT_EQ(booksOptionsFromDictionary(Dictionary()).maximumCard, BooksOptions().maximumCard);
}

// systemd itself says whether it would take them. The names have characters that mean something to it.
TEST(BooksUnits, AreWhatSystemdTakes) {
    const StoreDirectory directory;
    BooksOptions options = someBooks(directory.path("a b%c$d/books"));
    options.listen = "192.168.1.20";
    std::vector<std::string> command = {
        "env", "XDG_RUNTIME_DIR=" + directory.path(), "systemd-analyze", "--user", "--man=no", "verify"};
    for (const auto& [name, text] : renderBooksUnits(options, 4711, 5000, true)) {
        std::ofstream(directory.path(name)) << text;
        command.push_back(directory.path(name));
        if (name.ends_with(".service")) {
            EXPECT_TRUE(test::isConfined(directory.path(name)));
        }
    }
    const CommandResult verified = runCommand(command);
    EXPECT_EQ(verified.status, 0) << verified.output << verified.errors;
    EXPECT_THAT(verified.errors, Not(HasSubstr("rolvane-books"))) << verified.errors;
    const auto units = renderBooksUnits(options, 4711, 5000, true);
    EXPECT_EQ(linesThatBeginWith(units.at("rolvane-books.socket"), "ListenStream="),
              (std::set<std::string>{"ListenStream=127.0.0.1:4711", "ListenStream=[::1]:4711",
                                     "ListenStream=192.168.1.20:4711"}));
    EXPECT_THAT(units.at("rolvane-books-httpd.service"), HasSubstr("a b%%c$$d/books/conf/httpd.conf\" -k start"));
    EXPECT_EQ(linesThatBeginWith(units.at("rolvane-books-httpd.service"), "LimitCORE="),
              (std::set<std::string>{"LimitCORE=0"}))
        << "requests carry passwords, and so would a core file";
}

TEST(BooksDevices, HaveEachAPasswordOfTheirOwnThatIsKeptAsAHashOnly) {
    const StoreDirectory directory;
    const BooksDevices devices(directory.path("books"));
    EXPECT_TRUE(devices.all().empty());
    const std::string phone = devices.add("phone"), laptop = devices.add("ada@laptop");
    EXPECT_NE(phone, laptop);
    const std::string file = directory.path("books/conf/passwords");
    EXPECT_THAT(readFile(file), testing::AllOf(HasSubstr("phone:$2y$04$"), Not(HasSubstr(phone))));
    struct stat info {};
    ASSERT_EQ(stat(file.c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 07777, 0600u);
    ASSERT_EQ(devices.all().size(), 2u);
    EXPECT_EQ(devices.all()[0].name, "ada@laptop");
    EXPECT_FALSE(devices.all()[0].lastUse);
    EXPECT_NE(devices.add("phone"), phone) << "another one";
    EXPECT_TRUE(devices.remove("phone"));
    EXPECT_FALSE(devices.remove("phone"));
    EXPECT_EQ(devices.all().size(), 1u);
    for (const char* name : {"", "../x", "a b", "a:b", ".x", "a\nb"})
        EXPECT_THROW(devices.add(name), CXException) << name;
}

TEST(BooksDevices, PasswordsAreOf160RandomBits) {
    std::set<std::string> all;
    std::set<char> characters;
    for (int i = 0; i < 200; ++i) {
        const std::string password = BooksDevices::randomPassword();
        EXPECT_EQ(password.size(), 39u);
        for (size_t at = 0; at < password.size(); ++at) {
            EXPECT_EQ(password[at] == '-', at % 5 == 4) << password;
            if (password[at] != '-') characters.insert(password[at]);
        }
        all.insert(password);
    }
    EXPECT_EQ(all.size(), 200u);
    EXPECT_EQ(characters.size(), 32u);
}

} // namespace
} // namespace rolvane
