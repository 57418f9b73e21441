// `rolvane books` with the real httpd and module, asked by curl.

#include "BooksWorld.h"

#include "foundation/Base64.h"
#include "foundation/CXException.h"
#include "server/BooksServer.h"
#include "support/UnitExposure.h"
#include "support/UserWorld.h"

#include <csignal>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>
#include <sstream>
#include <sys/stat.h>
#include <unistd.h>

namespace rolvane::test {
namespace {

using testing::HasSubstr;
using testing::Not;
using Json = nlohmann::json;

class BooksCommand : public testing::Test {
protected:
    BooksCommand() { done({"add", "--first", "Ada", "--last", "Miller", "--email", "ada@example.org"}); }
    ~BooksCommand() override { world.rolvane({"books", "off"}); }

    std::string done(std::vector<std::string> arguments) {
        const Ran ran = world.rolvane(std::move(arguments));
        EXPECT_EQ(ran.status, 0) << ran;
        return ran.output;
    }
    Json json(std::vector<std::string> arguments, int status = 0) {
        arguments.emplace_back("--json");
        const Ran ran = world.rolvane(std::move(arguments));
        EXPECT_EQ(ran.status, status) << ran;
        return Json::parse(ran.output, nullptr, false);
    }
    // What curl says: the status, a line end, the body. It trusts the books' own authority and nothing else.
    std::string ask(const std::string& device, const std::string& password, const std::string& path = "books/",
                    std::vector<std::string> more = {}) {
        const Json told = Json::parse(world.rolvane({"books", "status", "--json"}).output);
        std::vector<std::string> command = {"curl", "-q", "-sS", "--noproxy", "*", "-w", "\n%{http_code}"};
        if (!told["caFile"].is_null()) command.insert(command.end(), {"--cacert", told["caFile"]});
        if (!device.empty()) command.insert(command.end(), {"-u", device + ":" + password});
        command.insert(command.end(), more.begin(), more.end());
        command.push_back(told["url"].get<std::string>() + path);
        const Ran ran = world.run(command);
        EXPECT_EQ(ran.status, 0) << ran;
        const size_t end = ran.output.rfind('\n');
        return ran.output.substr(end + 1) + "\n" + ran.output.substr(0, end);
    }
    std::string status(const std::string& device, const std::string& password) {
        return ask(device, password, "books/", {"-X", "PROPFIND", "-H", "Depth: 0"}).substr(0, 3);
    }
    // Of one request with each of the passwords, one after the other.
    std::string statuses(const std::string& device, const std::vector<std::string>& passwords) {
        const Json told = Json::parse(world.rolvane({"books", "status", "--json"}).output);
        std::vector<std::string> command = {"curl", "-q"};
        for (const std::string& password : passwords) {
            if (command.size() > 2) command.emplace_back("--next");
            for (const std::string& word :
                 {std::string("-sS"), std::string("--noproxy"), std::string("*"), std::string("--cacert"),
                  told["caFile"].get<std::string>(), std::string("-o"), std::string("/dev/null"), std::string("-w"),
                  std::string("%{http_code}\\n"), std::string("-X"), std::string("PROPFIND"), std::string("-u"),
                  device + ":" + password, told["url"].get<std::string>() + "books/"})
                command.push_back(word);
        }
        return world.run(command).output;
    }
    std::string addDevice(const std::string& name) { return json({"books", "device", "add", name})["password"]; }

    UserWorld world;
};

TEST_F(BooksCommand, AreServedToADeviceWithItsPasswordAndToNobodyElse) {
    const Json on = json({"books", "on"});
    EXPECT_TRUE(on["on"].get<bool>());
    EXPECT_THAT(on["url"].get<std::string>(), testing::MatchesRegex("https://localhost:[0-9]+/"));
    const std::string password = addDevice("laptop");
    const std::string listing = ask("laptop", password, "books/home/contacts/", {"-X", "PROPFIND", "-H", "Depth: 1"});
    EXPECT_THAT(listing, testing::StartsWith("207\n"));
    EXPECT_THAT(listing, HasSubstr(".vcf</"));
    EXPECT_EQ(status("", ""), "401");
    EXPECT_EQ(status("laptop", "wrong"), "401");
    EXPECT_EQ(status("phone", password), "401");
    EXPECT_EQ(ask("laptop", password, "../conf/passwords", {"--path-as-is"}).substr(0, 3), "400");
    EXPECT_EQ(ask("laptop", password, "conf/passwords").substr(0, 3), "403");
}

// RFC 6764 section 5. A stranger hears the same as a device: no device, no book, no other path. KAddressBook sends its
// password to the first address alone, and would go round in circles where that one asked for it.
TEST_F(BooksCommand, LeadOnFromTheHostAloneAndTellNothingElseBeforeASignIn) {
    const Json on = json({"books", "on"});
    const std::string password = addDevice("laptop");
    for (const std::string path : {"", ".well-known/carddav", ".well-known/carddav/"}) {
        for (const std::string method : {"GET", "PROPFIND", "OPTIONS"}) {
            SCOPED_TRACE(method + " /" + path);
            const std::vector<std::string> how = {"-X", method, "-w", "\n%{http_code} %{redirect_url}"};
            const std::string told = ask("", "", path, how);
            EXPECT_THAT(told, testing::StartsWith("301 " + on["url"].get<std::string>() + "books/\n"));
            EXPECT_EQ(ask("laptop", password, path, how), told);
            EXPECT_EQ(ask("laptop", "wrong", path, how), told);
            for (const char* word : {"laptop", "home", "principal", "contacts", "Miller"})
                EXPECT_THAT(told, Not(HasSubstr(word)));
        }
    }
    EXPECT_THAT(ask("", "", ".well-known/carddav", {"-i"}), HasSubstr("\r\nCache-Control: max-age=3600\r\n"));
    EXPECT_EQ(ask("", "", ".well-known/caldav").substr(0, 3), "403");
    for (const char* path : {"books", "books/", "books/principal/", "books/home/", "books/home/contacts/"})
        EXPECT_EQ(ask("", "", path).substr(0, 3), "401") << path;
    EXPECT_EQ(ask("", "", "bookshelf").substr(0, 3), "403");
}

TEST_F(BooksCommand, TheirPasswordsOpenNoStoreAndTheStoresOpenNoBooks) {
    const std::string store = world.store().baseURL() + "/" + UserWorld::kUser + "/";
    const std::string alice = UserWorld::kUser, word = UserWorld::kPassword;
    done({"books", "on"});
    const std::string password = json({"books", "device", "add", alice})["password"]; // called as the store's user is
    const auto ofStore = [&](const std::string& given) {
        return world
            .run({"curl", "-q", "-ksS", "--noproxy", "*", "-o", "/dev/null", "-w", "%{http_code}", "-X", "PROPFIND",
                  "-H", "Depth: 0", "-u", alice + ":" + given, store})
            .output;
    };
    EXPECT_EQ(ofStore(word), "207");
    EXPECT_EQ(ofStore(password), "401");
    EXPECT_EQ(status(alice, password), "207");
    EXPECT_EQ(status(alice, word), "401");
}

TEST_F(BooksCommand, ADeviceThatIsRemovedOrGotAnotherPasswordIsRefusedAtTheNextRequest) {
    done({"books", "on"});
    const std::string first = addDevice("phone"), laptop = addDevice("laptop");
    ASSERT_EQ(status("phone", first), "207");
    const Ran again = world.rolvane({"books", "device", "add", "phone"});
    EXPECT_EQ(again.status, 2) << again;
    EXPECT_THAT(again.errors, HasSubstr("--renew"));
    EXPECT_EQ(status("phone", first), "207");
    const std::string second = json({"books", "device", "add", "phone", "--renew"})["password"];
    EXPECT_EQ(status("phone", first), "401");
    EXPECT_EQ(status("phone", second), "207");
    done({"books", "device", "remove", "phone"});
    EXPECT_EQ(status("phone", second), "401");
    EXPECT_EQ(status("laptop", laptop), "207");
    EXPECT_EQ(world.rolvane({"books", "device", "remove", "phone"}).status, 3);
}

// Its request that is under way is answered, as the device was let in. The next one is not.
TEST_F(BooksCommand, ADeviceThatIsRemovedInTheMiddleOfARequestMakesNoOther) {
    const int port = json({"books", "on", "--no-tls"})["port"];
    const std::string login = "phone:" + addDevice("phone");
    std::string authorization = "Basic ";
    appendBase64(reinterpret_cast<const uint8_t*>(login.data()), login.size(), authorization);
    const RawRequest request{
        "",
        "REPORT",
        "/books/home/contacts/",
        {{"Authorization", authorization}, {"Content-Type", "application/xml"}, {"Expect", "100-continue"}},
        "<sync-collection xmlns=\"DAV:\"><sync-token/><sync-level>1</sync-level><prop><getetag/></prop>"
        "</sync-collection>"};
    RawUpload sync(port, request, 0);
    ASSERT_TRUE(sync.awaitContinue());
    done({"books", "device", "remove", "phone"});
    const RawAnswer answer = sync.finish();
    EXPECT_EQ(answer.status, 207);
    EXPECT_THAT(answer.body, HasSubstr("</D:multistatus>"));
    EXPECT_EQ(rawRequest(port, request).status, 401);
}

TEST_F(BooksCommand, TellWhenADeviceWasThereLast) {
    done({"books", "on"});
    const std::string password = addDevice("laptop");
    addDevice("phone");
    ASSERT_EQ(status("laptop", password), "207");
    const Json devices = json({"books", "devices"});
    ASSERT_EQ(devices.size(), 2U);
    EXPECT_EQ(devices[0]["name"], "laptop");
    EXPECT_TRUE(devices[0]["lastUse"].is_string());
    EXPECT_TRUE(devices[1]["lastUse"].is_null());
    EXPECT_THAT(done({"books", "devices"}), HasSubstr("phone               never used"));
}

TEST_F(BooksCommand, KeepPortDevicesAndCertificateFromOnToOn) {
    const Json first = json({"books", "on"});
    const std::string password = addDevice("laptop");
    EXPECT_EQ(json({"books", "on"})["process"], first["process"]) << "nothing has changed, so nothing is started anew";
    done({"books", "off"});
    EXPECT_EQ(json({"books", "status"}, 3)["on"], false);
    const Json second = json({"books", "on"});
    EXPECT_EQ(second["url"], first["url"]);
    EXPECT_EQ(second["fingerprint"], first["fingerprint"]);
    EXPECT_EQ(status("laptop", password), "207");
    const Json plain = json({"books", "on", "--no-tls"});
    EXPECT_THAT(plain["url"].get<std::string>(), testing::StartsWith("http://localhost:"));
    EXPECT_EQ(status("laptop", password), "207");
    EXPECT_EQ(status("laptop", "wrong"), "401");
}

// As at a login after the machine was started anew: the server is gone without an end, and its entry is run.
TEST_F(BooksCommand, ComeBackAtALoginWhereNoSystemdKeepsThem) {
    const Json on = json({"books", "on"});
    const std::string password = addDevice("laptop");
    const std::string entry = world.home / "config/autostart/rolvane-books.desktop";
    std::ifstream file(entry);
    const std::string text(std::istreambuf_iterator<char>(file), {});
    const size_t at = text.find("\nExec=") + 6;
    const std::string command = text.substr(at, text.find('\n', at) - at);
    ASSERT_THAT(command, HasSubstr("books on")) << text;
    BooksOptions options;
    options.stateDirectory = world.home / "state/rolvane/books";
    const pid_t server = on["process"].get<pid_t>();
    kill(server, SIGKILL);
    while (BooksServer(options).status().on) usleep(1000);
    EXPECT_EQ(world.run({"sh", "-c", command}).status, 0);
    EXPECT_EQ(json({"books", "status"})["url"], on["url"]);
    EXPECT_EQ(status("laptop", password), "207");
    done({"books", "off"});
    EXPECT_FALSE(std::ifstream(entry).good()) << "off stays off";
}

TEST_F(BooksCommand, KeepSecretsToTheirUser) {
    done({"books", "on"});
    const std::string password = addDevice("laptop");
    const std::string state = world.home / "state/rolvane/books";
    for (const char* secret : {"/conf/passwords", "/tls/server.key", "/conf/httpd.conf"}) {
        struct stat info {};
        ASSERT_EQ(stat((state + secret).c_str(), &info), 0) << secret;
        EXPECT_EQ(info.st_mode & 077, 0U) << secret;
    }
    struct stat info {};
    ASSERT_EQ(stat(state.c_str(), &info), 0);
    EXPECT_EQ(info.st_mode & 077, 0U);
    std::ifstream file(state + "/conf/passwords");
    const std::string text(std::istreambuf_iterator<char>(file), {});
    EXPECT_THAT(text, Not(HasSubstr(password)));
}

TEST_F(BooksCommand, GuessesArePutOffAndADeviceThatIsInStaysIn) {
    done({"books", "on"});
    const std::string laptop = addDevice("laptop"), phone = addDevice("phone");
    ASSERT_EQ(status("laptop", laptop), "207");
    // The right one right behind the guesses, by one process. Where that was held up longer than the first pause lasts,
    // the device got in, and it begins anew.
    constexpr int kGuesses = 8, kRounds = 30;
    std::vector<std::string> passwords;
    for (int i = 0; i < kGuesses; ++i) passwords.push_back("guess" + std::to_string(i));
    passwords.push_back(phone);
    std::string codes;
    for (int round = 0; round < kRounds && !codes.ends_with("401\n"); ++round) {
        codes = statuses("phone", passwords);
        EXPECT_THAT(codes, testing::StartsWith("401\n401\n401\n401\n401\n401\n401\n401\n"));
    }
    EXPECT_THAT(codes, testing::EndsWith("401\n")) << "in a pause the right one is not looked at either";
    EXPECT_EQ(status("laptop", laptop), "207");
}

TEST_F(BooksCommand, ThatAreWantedElsewhereNeedTLSAndAnAddress) {
    const Ran plain = world.rolvane({"books", "on", "--listen", "127.0.0.1", "--no-tls"});
    EXPECT_EQ(plain.status, 1) << plain;
    EXPECT_THAT(plain.errors, HasSubstr("Leave out --listen or --no-tls"));
    const Ran named = world.rolvane({"books", "on", "--listen", "my-machine"});
    EXPECT_EQ(named.status, 1) << named;
    EXPECT_THAT(named.errors, HasSubstr("is no address of this machine"));
    EXPECT_EQ(world.rolvane({"books", "on", "--listen", "127.0.0.2", "--loopback"}).status, 2);
    EXPECT_EQ(json({"books", "status"}, 3)["on"], false);
}

// The code is read by a reader of its own.
TEST_F(BooksCommand, AQRCodeHoldsAddressNameAndPassword) {
    const Json on = json({"books", "on"});
    const Ran ran = world.rolvane({"books", "device", "add", "my@phone", "--qr"});
    ASSERT_EQ(ran.status, 0) << ran;
    std::vector<std::string> rows; // '1' is dark
    std::string password;
    std::istringstream lines(ran.output);
    for (std::string line; std::getline(lines, line);) {
        if (line.starts_with("Password ")) password = line.substr(line.rfind(' ') + 1);
        if (line.starts_with("Address ") || line.starts_with("User name ") || line.starts_with("Password ")) continue;
        std::string upper, lower;
        for (size_t i = 0; i < line.size();) {
            const std::string block = line[i] == ' ' ? " " : line.substr(i, 3);
            i += block.size();
            upper += block == "█" || block == "▀" ? "0 " : "1 ";
            lower += block == "█" || block == "▄" ? "0 " : "1 ";
        }
        rows.push_back(upper);
        rows.push_back(lower);
    }
    ASSERT_GT(rows.size(), 20U);
    constexpr size_t kScale = 4; // pixels a module
    std::string picture =
        "P1\n" + std::to_string(rows[0].size() / 2 * kScale) + " " + std::to_string(rows.size() * kScale) + "\n";
    for (const std::string& row : rows) {
        std::string wide;
        for (size_t i = 0; i < row.size(); i += 2)
            for (size_t k = 0; k < kScale; ++k) wide += row.substr(i, 2);
        for (size_t k = 0; k < kScale; ++k) picture += wide + "\n";
    }
    const Ran read = world.run({"zbarimg", "-q", "--raw", world.write("code.pbm", picture)});
    const std::string url = on["url"];
    EXPECT_EQ(read.output, "carddavs://my%40phone:" + password + "@" + url.substr(url.find("localhost")) + "\n")
        << read;
}

// vdirsyncer asks for it where both sides of a link have changed a card.
TEST_F(BooksCommand, OneCardOfTwoHasWhatEitherHas) {
    const auto card = [](const std::string& lines) {
        return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:one\r\nFN:Ada\r\nN:;Ada;;;\r\n" + lines + "END:VCARD\r\n";
    };
    const std::string first =
        world.write("a.vcf", card("EMAIL;TYPE=HOME:ada@example.org\r\nEMAIL;TYPE=WORK:a@work.example\r\nTITLE:Cook\r\n"
                                  "NOTE:first\r\nX-OURS:1\r\n"));
    const std::string second = world.write(
        "b.vcf", card("EMAIL;TYPE=HOME:ada@example.org\r\nTEL;TYPE=HOME:+1 555 0100\r\nTITLE:Chef\r\nX-THEIRS:2\r\n"));
    done({"books", "merge-cards", first, second});
    const auto textOf = [](const std::string& path) {
        std::ifstream file(path, std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(file), {});
    };
    const std::string merged = textOf(first);
    EXPECT_EQ(textOf(second), merged);
    for (const char* part : {"UID:one", "ada@example.org", "a@work.example", "+1 555 0100", "TITLE:Cook", "first",
                             "Chef", "X-OURS:1", "X-THEIRS:2"})
        EXPECT_THAT(merged, HasSubstr(part));
    EXPECT_EQ(merged.find("ada@example.org"), merged.rfind("ada@example.org")) << "what both have is there once";
    EXPECT_EQ(merged.find("UID"), merged.rfind("UID")) << merged;
    const std::string none = world.write("c.vcf", "no card");
    EXPECT_EQ(world.rolvane({"books", "merge-cards", first, none}).status, 1);
    EXPECT_EQ(textOf(first), merged) << "nothing is changed";
}

TEST_F(BooksCommand, SayWhatToDoWhenTheyCannotBeSwitchedOn) {
    const Ran device = world.rolvane({"books", "device", "add", "phone"});
    EXPECT_EQ(device.status, 1) << device;
    EXPECT_THAT(device.errors, HasSubstr("rolvane books on"));
    EXPECT_THAT(json({"books", "devices"}), testing::IsEmpty()) << "a password that nobody has seen is no use";
    const int port = json({"books", "on"})["port"];
    BooksOptions options = BooksServer::savedOptions(world.home / "state/rolvane/books").value();
    options.stateDirectory = world.home / "second";
    options.serviceManager = false;
    const auto reasonOf = [](const BooksOptions& given) -> std::string {
        try {
            BooksServer(given).on();
        } catch (const CXException& e) {
            return e.reason();
        }
        return "";
    };
    options.port = port;
    EXPECT_THAT(reasonOf(options),
                testing::AllOf(HasSubstr("port " + std::to_string(port) + ", which is taken"), HasSubstr("--port")));
    options.port = 0;
    options.httpdProgram = "/nowhere/apache2";
    EXPECT_THAT(reasonOf(options), HasSubstr("Install the package apache2-bin"));
    options.httpdProgram = BooksOptions().httpdProgram;
    options.database = world.home / "none.db";
    EXPECT_THAT(reasonOf(options), HasSubstr("There is no contact database at"));
}

// A user who is not root, whoever runs the test.
class BooksOfAnOrdinaryUser : public BooksCommand {
protected:
    BooksOfAnOrdinaryUser() {
        if (geteuid() != 0) return;
        _prefix = {"setpriv", "--reuid", "65534", "--regid", "65534", "--clear-groups"};
        world.run({"chown", "-R", "65534:65534", world.home.path()});
    }
    ~BooksOfAnOrdinaryUser() override { user({"books", "off"}); }
    Ran run(std::vector<std::string> command) {
        command.insert(command.begin(), _prefix.begin(), _prefix.end());
        return world.run(command);
    }
    Ran user(std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), UserWorld::rolvaneProgram());
        return run(arguments);
    }
    std::string codeOf(const std::string& url, const Json& on, const std::string& password) {
        return run({"curl", "-q", "-sS", "--noproxy", "*", "--cacert", on["caFile"], "-o", "/dev/null", "-w",
                    "%{http_code}", "-u", "phone:" + password, "-X", "PROPFIND", "-H", "Depth: 0", url + "books/"})
            .output;
    }

private:
    std::vector<std::string> _prefix;
};

TEST_F(BooksOfAnOrdinaryUser, AreReachedAtTheAddressThatWasAskedFor) {
    const Ran ran = user({"books", "on", "--listen", "127.0.0.2", "--host", "books.example.org", "--json"});
    ASSERT_EQ(ran.status, 0) << ran;
    const Json on = Json::parse(ran.output);
    EXPECT_THAT(on["outsideURL"].get<std::string>(), testing::StartsWith("https://127.0.0.2:"));
    const Ran device = user({"books", "device", "add", "phone", "--json"});
    ASSERT_EQ(device.status, 0) << device;
    const Json phone = Json::parse(device.output);
    EXPECT_EQ(phone["url"], on["outsideURL"]) << "the device is told the address that it can reach";
    EXPECT_EQ(codeOf(on["outsideURL"], on, phone["password"]), "207");
    EXPECT_EQ(codeOf(on["url"], on, phone["password"]), "207");
    const Ran back = user({"books", "on", "--loopback", "--json"});
    EXPECT_TRUE(Json::parse(back.output)["outsideURL"].is_null()) << back;
}

TEST_F(BooksOfAnOrdinaryUser, ShowACertificateOfOnesOwn) {
    const std::string directory = world.home.path();
    const auto make = [&](const std::string& name) {
        const Ran made = run({"openssl", "req", "-x509", "-newkey", "rsa:2048", "-nodes", "-days", "2", "-subj",
                              "/CN=localhost", "-addext", "subjectAltName=DNS:localhost,IP:127.0.0.2", "-keyout",
                              directory + "/" + name + ".key", "-out", directory + "/" + name + ".pem"});
        ASSERT_EQ(made.status, 0) << made;
    };
    make("mine");
    make("other");
    const std::string mine = directory + "/mine.pem";
    const Ran wrong =
        user({"books", "on", "--listen", "127.0.0.2", "--certificate", mine, "--key", directory + "/other.key"});
    EXPECT_EQ(wrong.status, 1) << wrong;
    EXPECT_THAT(wrong.errors, HasSubstr("other.key\" holds no key of that certificate"));
    EXPECT_EQ(user({"books", "on", "--certificate", mine}).status, 2) << "without its key";
    const Ran ran = user(
        {"books", "on", "--listen", "127.0.0.2", "--certificate", mine, "--key", directory + "/mine.key", "--json"});
    ASSERT_EQ(ran.status, 0) << ran;
    Json on = Json::parse(ran.output);
    EXPECT_TRUE(on["caFile"].is_null());
    const Ran shown = run({"openssl", "x509", "-in", mine, "-noout", "-fingerprint", "-sha256"});
    EXPECT_THAT(shown.output, HasSubstr(on["fingerprint"].get<std::string>()));
    const Json phone = Json::parse(user({"books", "device", "add", "phone", "--json"}).output);
    on["caFile"] = mine;
    EXPECT_EQ(codeOf(on["outsideURL"], on, phone["password"]), "207");
    EXPECT_EQ(codeOf(on["url"], on, phone["password"]), "207");
    const Json again = Json::parse(user({"books", "on", "--json"}).output);
    EXPECT_EQ(again["fingerprint"], on["fingerprint"]) << "it is kept";
    const Json made = Json::parse(user({"books", "on", "--made-certificate", "--json"}).output);
    EXPECT_NE(made["fingerprint"], on["fingerprint"]);
    EXPECT_EQ(codeOf(made["outsideURL"], made, phone["password"]), "207");
}

TEST_F(BooksOfAnOrdinaryUser, AServiceManagerKeepsThePortAndHandsConnectionsOn) {
    ASSERT_EQ(symlink(ROLVANE_SOURCE_DIR "/tests/books/service-manager", (world.home / "systemctl").c_str()), 0);
    world.home.setVariable("PATH", world.home.path() + ":" + std::getenv("PATH"));
    const Ran ran = user({"books", "on", "--json"});
    ASSERT_EQ(ran.status, 0) << ran;
    const Json on = Json::parse(ran.output);
    EXPECT_EQ(on["startedBy"], "systemd");
    EXPECT_TRUE(on["on"].get<bool>());
    const Json phone = Json::parse(user({"books", "device", "add", "phone", "--json"}).output);
    EXPECT_EQ(codeOf(on["url"], on, phone["password"]), "207") << "TLS and all, through the unit's socket";
    EXPECT_EQ(codeOf(on["url"], on, "wrong"), "401");
    EXPECT_EQ(user({"books", "off"}).status, 0);
    const Ran status = user({"books", "status", "--json"});
    EXPECT_EQ(status.status, 3) << status;
    std::ifstream file(world.home / "asked");
    const std::string asked(std::istreambuf_iterator<char>(file), {});
    EXPECT_THAT(asked, HasSubstr("--user daemon-reload\n--user enable --now rolvane-books.socket\n"));
    EXPECT_THAT(asked, HasSubstr("--user disable --now rolvane-books.socket\n"));
    EXPECT_FALSE(std::ifstream(world.home / "config/systemd/user/rolvane-books.socket").good()) << "taken back";
}

TEST_F(BooksOfAnOrdinaryUser, ALinkIsKeptInStepByATimerOfTheServiceManager) {
    ASSERT_EQ(symlink(ROLVANE_SOURCE_DIR "/tests/books/service-manager", (world.home / "systemctl").c_str()), 0);
    world.home.setVariable("PATH", world.home.path() + ":" + std::getenv("PATH"));
    BooksWorld elsewhere;
    elsewhere.addPerson("Zoe", "There");
    const std::string there = "http://127.0.0.1:" + std::to_string(elsewhere.port()) + kContacts;
    ASSERT_EQ(user({"books", "on"}).status, 0);
    const Ran linked = user(
        {"books", "link", there, "--user", "laptop", "--password-command", "echo '" + rawPasswordOf("laptop") + "'"});
    ASSERT_EQ(linked.status, 0) << linked;
    EXPECT_THAT(linked.errors, HasSubstr("It is kept so every five minutes."));
    EXPECT_EQ(user({"list", "Zoe There"}).status, 0) << "it is in step at once";
    const std::string units = world.home / "config/systemd/user/rolvane-books-link";
    const auto unit = [&](const std::string& kind) {
        std::ifstream file(units + kind);
        return std::string(std::istreambuf_iterator<char>(file), {});
    };
    EXPECT_THAT(unit(".timer"), HasSubstr("OnUnitActiveSec=5min\n"));
    EXPECT_TRUE(isConfined(units + ".service"));
    elsewhere.addPerson("Yan", "Later");
    const std::string service = unit(".service"), key = "ExecStart=";
    ASSERT_THAT(service, HasSubstr(key));
    const size_t line = service.find(key) + key.size();
    const Ran timed = run({"sh", "-c", service.substr(line, service.find('\n', line) - line)});
    EXPECT_EQ(timed.status, 0) << timed;
    EXPECT_EQ(user({"list", "Yan Later"}).status, 0) << "what the timer runs brings it";
    const Json told = Json::parse(user({"status", "--json"}).output)["books"]["links"];
    ASSERT_EQ(told.size(), 1U);
    EXPECT_EQ(told[0]["url"], there);
    EXPECT_TRUE(told[0]["good"].get<bool>());
    EXPECT_EQ(user({"books", "unlink"}).status, 0);
    EXPECT_EQ(unit(".timer") + unit(".service"), "");
    std::ifstream file(world.home / "asked");
    const std::string asked(std::istreambuf_iterator<char>(file), {});
    EXPECT_THAT(asked, HasSubstr("--user enable --now rolvane-books-link.timer\n"));
    EXPECT_THAT(asked, HasSubstr("--user disable --now rolvane-books-link.timer"));
}

} // namespace
} // namespace rolvane::test
