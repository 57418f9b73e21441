#include "CommandWorld.h"

#include "foundation/Url.h"
#include "server/LoopbackPort.h"
#include "store/account/CertificateChain.h"
#include "store/account/Invitation.h"

#include <gmock/gmock.h>

#include <filesystem>
#include <fstream>
#include <unistd.h>

// A store for several households, kept by a user of its own, with people who are somebody else.

namespace rolvane::test {
namespace {

namespace fs = std::filesystem;
using testing::HasSubstr;

class Household : public testing::Test {
protected:
    Household() : port(LoopbackPort::choose()) {
        fs::permissions(directory.path(), fs::perms(0755));
        install(UserWorld::rolvaneProgram(), "bin/rolvane");
        install(UserWorld::managerProgram(), "bin/RolvaneManager");
        install(ROLVANE_MODULE, "lib/apache2/modules/mod_davacl.so");
        install(ROLVANE_SOURCE_DIR "/server/httpd.conf.in", "share/rolvane/httpd.conf.in");
        for (const char* user : kPeople) {
            fs::create_directory(home(user));
            if (::geteuid() == 0 && ::chown(home(user).c_str(), number(user), number(user)) != 0)
                ADD_FAILURE() << "no home for " << user;
            fs::permissions(home(user), fs::perms::owner_all);
        }
    }
    ~Household() override {
        for (const char* user : kPeople) as(user, "rolvane daemon stop");
        as("keeper", "rolvane store stop --now " + place());
        for (const auto& each : fs::directory_iterator(home("keeper")))
            if (fs::exists(each.path() / "store.plist"))
                as("keeper", "rolvane store stop --now --directory " + each.path().string());
    }
    static constexpr const char* kPeople[] = {"keeper", "ada", "ben"};
    static uid_t number(const std::string& user) { return user == "keeper" ? 61003 : user == "ada" ? 61004 : 61005; }
    std::string home(const std::string& user) const { return directory / user; }
    std::string place() const { return "--directory " + home("keeper") + "/store"; }
    void install(const std::string& from, const std::string& to) {
        const std::string path = directory / to;
        fs::create_directories(fs::path(path).parent_path());
        fs::copy_file(from, path);
        for (fs::path up = path; up != directory.path(); up = up.parent_path()) fs::permissions(up, fs::perms(0755));
    }
    // A line of shell, typed by that person.
    Ran as(const std::string& user, const std::string& line) {
        std::vector<std::string> command;
        if (::geteuid() == 0)
            command = {"setpriv", "--reuid=" + std::to_string(number(user)), "--regid=" + std::to_string(number(user)),
                       "--clear-groups"};
        command.insert(command.end(), {"env", "-i", "HOME=" + home(user), "LANG=C.UTF-8", "ROLVANE_NEWS=never",
                                       "PATH=" + (directory / "bin") + ":/usr/bin:/bin:/usr/sbin", "sh", "-c",
                                       "cd && umask 077 && " + line});
        return world.run(command, "", 120);
    }
    std::string done(const std::string& user, const std::string& line) {
        const Ran ran = as(user, line);
        EXPECT_EQ(ran.status, kDone) << user << "$ " << line << "\n" << ran;
        return ran.output;
    }
    void settings(const std::string& more) {
        std::ofstream(directory / "store.conf") << "name = localhost\nport = " << port << "\n" << more;
        fs::permissions(directory / "store.conf", fs::perms(0644));
    }
    Ran start() { return as("keeper", "rolvane store start " + place() + " --settings " + (directory / "store.conf")); }
    Ran reload() {
        return as("keeper", "rolvane store reload " + place() + " --settings " + (directory / "store.conf"));
    }
    std::string invite(const std::string& user, const std::string& more = "") {
        const std::string shown =
            done("keeper", "rolvane store user add " + user + " --invite " + more + " " + place());
        return shown.substr(0, shown.find('\n'));
    }
    void setUp(const std::string& user, const std::string& more = "") {
        done(user, "rolvane setup '" + invite(user, user == "ben" ? "--inviter ada" : "") + "' --no-input " + more);
    }
    // A certificate for localhost in files that the keeper may read, signed by an authority of this test's.
    void makeCertificate(const std::string& serial) {
        done("keeper",
             "test -e ca.pem || openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes -days 30 "
             "-subj /CN=Club -keyout ca.key -out ca.pem -addext basicConstraints=critical,CA:TRUE");
        done("keeper",
             "openssl req -new -newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes -subj /CN=localhost -keyout "
             "new.key -out new.csr && printf 'subjectAltName=DNS:localhost\\n' >ext && openssl x509 -req -days "
             "20 -in new.csr -CA ca.pem -CAkey ca.key -set_serial " +
                 serial + " -extfile ext -out new.pem && cat new.pem ca.pem >chain.pem && mv new.key key.pem");
    }
    std::string url() const { return "https://localhost:" + std::to_string(port) + "/"; }

    CommandWorld world;
    TempDirectory directory;
    const int port;
};

TEST_F(Household, WithAnAuthorityOfItsOwnInvitesTwoWhoShare) {
    settings("certificate = own\nquota = 100M\n");
    const Ran started = start();
    ASSERT_EQ(started.status, kDone) << started;
    EXPECT_THAT(started.output, HasSubstr("https://localhost:" + std::to_string(port) + "/dav/{user}/Contacts"));
    setUp("ada");
    const std::string bens = invite("ben", "--inviter ada");
    done("ada", "rolvane add --first Ida && rolvane group create Family Ida && rolvane publish --group Family");
    done("ada", "rolvane share ben --write");
    EXPECT_EQ(as("keeper", "rolvane store user add x --invite --inviter nobody " + place()).status, kNoSuchThing);
    done("ben", "rolvane setup '" + bens + "' --no-input --subscribe");
    EXPECT_THAT(done("ben", "rolvane list --of ada"), HasSubstr("Ida"));
    const auto rooms = nlohmann::json::parse(done("keeper", "rolvane store user quota --json " + place()));
    ASSERT_EQ(rooms.size(), 2U);
    EXPECT_GT(rooms[0]["used"].get<int64_t>(), 4096);
    EXPECT_EQ(rooms[0]["quota"], "100M");
}

TEST_F(Household, OfGivenFilesIsBelievedByItsChainAndTakesARenewedCertificateIn) {
    makeCertificate("4711");
    settings("certificate = " + home("keeper") + "/chain.pem\nkey = " + home("keeper") + "/key.pem\n");
    ASSERT_EQ(start().status, kDone);
    const auto authority = certificatesIn(done("keeper", "cat ca.pem"));
    ASSERT_EQ(authority.size(), 1U);
    const std::string line = invite("ada");
    EXPECT_EQ(Invitation::fromLine(line).fingerprint, authority.front().fingerprint);
    done("ada", "rolvane setup '" + line + "' --no-input");

    const auto first = certificatesShownAt(Url(url())).front().fingerprint;
    makeCertificate("4712");
    EXPECT_EQ(certificatesShownAt(Url(url())).front().fingerprint, first) << "not yet";
    EXPECT_EQ(reload().status, kDone);
    bool isNew = false;
    for (int i = 0; i < 200 && !isNew; ++i) {
        isNew = certificatesShownAt(Url(url())).front().fingerprint != first;
        if (!isNew) usleep(50'000);
    }
    EXPECT_TRUE(isNew);
    done("ada", "rolvane account test");
}

TEST_F(Household, KeepsItsSettingsWhereNewOnesCannotBeUsed) {
    settings("certificate = own\n");
    ASSERT_EQ(start().status, kDone);
    for (const char* wrong : {"certificate = /nowhere.pem\nkey = /nowhere.key\n", "quota = much\n", "colour = red\n"}) {
        settings(wrong);
        EXPECT_EQ(reload().status, kFailure) << wrong;
    }
    settings("certificate = own\nport = 1\n");
    EXPECT_EQ(reload().status, kFailure) << "another port";
    EXPECT_EQ(as("keeper", "rolvane store status " + place()).status, kDone);
    settings("certificate = own\n");
    EXPECT_EQ(reload().status, kDone);
}

TEST_F(Household, LeavesNothingInTheHomeOfWhoeverAdministersIt) {
    settings("certificate = own\n");
    ASSERT_EQ(start().status, kDone);
    done("keeper", "mkdir home && HOME=$PWD/home rolvane store user list " + place() +
                       " && HOME=$PWD/home rolvane store user quota " + place());
    EXPECT_EQ(done("keeper", "ls -A home"), "");
}

TEST_F(Household, TellsAPersonWithoutRoomAndLosesNothing) {
    settings("certificate = own\nquota = 1M\n");
    ASSERT_EQ(start().status, kDone);
    setUp("ada");
    done("ada", "rolvane publish");
    done("keeper", "rolvane store user quota ada 160K " + place());
    std::string cards;
    for (int i = 0; i < 60; ++i)
        cards += "BEGIN:VCARD\r\nVERSION:3.0\r\nFN:Person " + std::to_string(i) + "\r\nN:" + std::to_string(i) +
                 ";Person;;;\r\nEND:VCARD\r\n";
    std::ofstream(directory / "cards.vcf") << cards;
    fs::permissions(directory / "cards.vcf", fs::perms(0644));
    done("ada", "rolvane import " + (directory / "cards.vcf"));
    const Ran full = as("ada", "rolvane sync");
    EXPECT_NE(full.status, kDone);
    EXPECT_THAT(full.errors + full.output, HasSubstr("no room left"));
    EXPECT_THAT(as("ada", "rolvane status").output, HasSubstr("no room left"));
    EXPECT_THAT(done("ada", "rolvane list --json | grep -c '\"name\"'"), HasSubstr("60"));
    done("keeper", "rolvane store user quota ada default " + place());
    done("ada", "rolvane sync");
    setUp("ben");
    done("ada", "rolvane share ben");
    done("ben", "rolvane subscribe ada");
    EXPECT_THAT(done("ben", "rolvane list --of ada --json | grep -c '\"name\"'"), HasSubstr("60"));
}

TEST_F(Household, ComesBackFromABackupOnAnotherMachine) {
    settings("certificate = own\nquota = 1M\n");
    ASSERT_EQ(start().status, kDone);
    setUp("ada");
    done("ada", "rolvane add --first Ida && rolvane publish");
    setUp("ben");
    done("ada", "rolvane share ben");
    done("keeper", "rolvane store user quota ada 2M " + place());
    done("keeper", "mkdir backups && for i in 1 2 3; do rolvane store backup backups --keep 2 " + place() + "; done");
    EXPECT_EQ(done("keeper", "ls backups | wc -l"), "2\n");
    EXPECT_EQ(done("keeper", "stat -c %a backups/* | sort -u"), "600\n");
    EXPECT_EQ(done("keeper", "ls -A backups | grep -vc '^rolvane-store-.*[.]tar[.]gz$' || true"), "0\n");
    EXPECT_EQ(as("keeper", "rolvane store restore --yes backups/* " + place()).status, kWrongLine) << "two files";
    const std::string file = "$(ls backups/* | tail -1)";
    EXPECT_EQ(as("keeper", "rolvane store restore --yes " + file + " " + place()).status, kFailure) << "it runs";
    EXPECT_EQ(as("keeper", "rolvane store restore " + file + " --directory " + home("keeper") + "/other").status,
              kNotAllowed)
        << "nobody was asked";
    done("keeper", "rolvane store stop --now " + place());
    done("keeper", "rolvane store restore --yes - --directory " + home("keeper") + "/other < " + file);
    done("keeper", "rolvane store start --directory " + home("keeper") + "/other");
    done("ada", "rolvane account test"); // the same password, the same authority
    done("ben", "rolvane subscribe ada");
    EXPECT_THAT(done("ben", "rolvane list --of ada"), HasSubstr("Ida"));
    EXPECT_THAT(done("keeper", "rolvane store user quota ada --directory " + home("keeper") + "/other"),
                HasSubstr("2M (own)"));
    done("keeper", "rolvane store stop --now --directory " + home("keeper") + "/other");
    // Damaged, it changes nothing.
    done("keeper", "head -c 3000 " + file + " >cut.tar.gz");
    EXPECT_EQ(as("keeper", "rolvane store restore --yes cut.tar.gz " + place()).status, kFailure);
    EXPECT_EQ(done("keeper", "rolvane store user list " + place()), "ada\nben\n");
}

TEST_F(Household, WithACertificateOfAnACMEAuthorityNeedsNoFiles) {
    ASSERT_TRUE(fs::exists("/usr/bin/pebble")) << "the package pebble";
    makeCertificate("1"); // of the authority's own address
    const int acme = LoopbackPort::choose(), management = LoopbackPort::choose();
    std::ofstream(directory / "pebble.json")
        << R"({"pebble": {"listenAddress": "127.0.0.1:)" << acme << R"(", "managementListenAddress": "127.0.0.1:)"
        << management << R"(", "certificate": ")" << home("keeper") << R"(/chain.pem", "privateKey": ")"
        << home("keeper") << R"(/key.pem", "httpPort": 1, "tlsPort": )" << port
        << R"(, "ocspResponderURL": "", "externalAccountBindingRequired": false}})";
    ChildProcess pebble(
        {"env", "PEBBLE_VA_NOSLEEP=1", "PEBBLE_WFE_NONCEREJECT=0", "pebble", "-config", directory / "pebble.json"});
    settings("certificate = acme\nacme-directory = https://localhost:" + std::to_string(acme) +
             "/dir\nacme-contact = keeper@example.org\nacme-authority = " + home("keeper") + "/ca.pem\n");
    ASSERT_TRUE(LoopbackPort::answers(acme, true, std::chrono::seconds(10)) || [&] {
        for (int i = 0; i < 200; ++i, usleep(50'000))
            if (LoopbackPort::answers(acme, true, std::chrono::seconds(10))) return true;
        return false;
    }()) << "pebble";
    const Ran started = start();
    ASSERT_EQ(started.status, kDone) << started;
    EXPECT_EQ(as("keeper", "rolvane store user add ada --invite " + place()).status, kFailure)
        << "there is no certificate yet";
    const auto shownIssuer = [&] { return certificatesShownAt(Url(url())).front().issuer; };
    for (int i = 0; i < 1200 && shownIssuer().find("Pebble") == std::string::npos; ++i) usleep(50'000);
    ASSERT_THAT(shownIssuer(), HasSubstr("Pebble")) << done("keeper", "tail -40 store/logs/error.log");
    setUp("ada");
    done("ada", "rolvane account test");
}

} // namespace
} // namespace rolvane::test
