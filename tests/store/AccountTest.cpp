#include "store/account/Account.h"
#include "foundation/CXException.h"
#include "foundation/Paths.h"
#include "store/account/CXNetworkController.h"
#include "store/reads/VersionMemory.h"
#include "support/TempHome.h"

#include <csignal>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <rapidcheck.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>

namespace rolvane {
namespace {

using namespace test;
using testing::HasSubstr;

CXDAVAccount sample() {
    CXDAVAccount a;
    a.user = UserName("alice");
    a.endpoint = "https://dav.example.org:8443/dav/{user}/Contacts";
    return a;
}

std::string reasonOf(const PasswordSource& source) {
    CXDAVAccount a = sample();
    a.passwordSource = source;
    try {
        return "password: " + a.password();
    } catch (const CXException& e) {
        return e.reason();
    }
}

TEST(Account, ALocationIsANameAndItsBytesAreWhereTheTemplateSays) {
    const CXDAVAccount a = sample();
    const Url base = a.baseLocationFor(UserName("bob b"));
    EXPECT_EQ(base.absoluteString(), "http://dav.example.org:8443/bob%20b/Contacts");
    EXPECT_EQ(a.endpointFor(base, false)->absoluteString(), "https://dav.example.org:8443/dav/bob%20b/Contacts");
    EXPECT_EQ(a.endpointFor(base.cxURLByAppendingComponent("A:CXGroup"), true)->absoluteString(),
              "https://dav.example.org:8443/dav/bob%20b/Contacts/A%3ACXGroup");
}

TEST(Account, NamesAndBytesAreEachOthersInverseForEveryUser) {
    const CXDAVAccount a = sample();
    const auto safe = [](char c) { return static_cast<unsigned char>(c) >= 0x20 && c != 0x7f && c != '/'; };
    const auto segment = rc::gen::suchThat(
        rc::gen::nonEmpty(rc::gen::container<std::string>(rc::gen::suchThat(rc::gen::arbitrary<char>(), safe))),
        [](const std::string& s) { return s != "." && s != ".."; });
    const bool held = rc::check([&] {
        Url name = a.baseLocationFor(UserName(*segment));
        for (const auto& below : *rc::gen::container<std::vector<std::string>>(segment))
            name = name.cxURLByAppendingComponent(below);
        const auto bytes = a.endpointFor(name, false);
        RC_ASSERT(bytes.has_value());
        RC_ASSERT(a.nameFor(bytes->absoluteString()) == name);
        RC_ASSERT(a.nameFor(bytes->encodedPath() + "/") == name);
    });
    EXPECT_TRUE(held);
}

TEST(Account, ANameHostOfItsOwnKeepsLocationsWhenTheStoreMoves) {
    CXDAVAccount a = sample();
    a.nameHost = "contacts.example.org";
    EXPECT_EQ(a.baseLocationFor(a.user).absoluteString(), "http://contacts.example.org/alice/Contacts");
    EXPECT_TRUE(a.endpointFor(Url("http://Contacts.Example.org/alice/Contacts/info"), false));
    EXPECT_FALSE(a.endpointFor(Url("http://dav.example.org:8443/alice/Contacts/info"), false));
}

TEST(Account, AnAccountIsSavedForItsOwnerOnlyAndComesBackTheSame) {
    TempHome home;
    EXPECT_FALSE(CXDAVAccount::load());
    CXDAVAccount a = sample();
    a.passwordSource = {PasswordSource::Kind::command, "echo x"};
    a.authentication = Authentication::digest;
    a.save();
    struct stat st {};
    ASSERT_EQ(stat(CXDAVAccount::defaultPath().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    EXPECT_EQ(CXDAVAccount::load(), a);
}

TEST(Account, WhatIsWrongWithAnAccountIsSaidInWords) {
    const auto problem = [](auto change) {
        CXDAVAccount a = sample();
        change(a);
        return a.problem().value_or("");
    };
    EXPECT_EQ(problem([](auto&) {}), "");
    EXPECT_THAT(problem([](auto& a) { a.user = UserName(""); }), HasSubstr("no user name"));
    EXPECT_THAT(problem([](auto& a) { a.user = UserName("<self>"); }), HasSubstr("cannot be a user name"));
    EXPECT_THAT(problem([](auto& a) { a.user = UserName(".."); }), HasSubstr("cannot be a user name"));
    EXPECT_THAT(problem([](auto& a) { a.endpoint = "https://h/dav/Contacts"; }), HasSubstr("{user}"));
    EXPECT_THAT(problem([](auto& a) { a.endpoint = "https://u:p@h/{user}/Contacts"; }), HasSubstr("is not a URL"));
    EXPECT_THAT(problem([](auto& a) { a.endpoint = "http://dav.example.org/{user}"; }), HasSubstr("not encrypted"));
    EXPECT_THAT(problem([](auto& a) {
                    a.endpoint = "http://dav.example.org/{user}";
                    a.plainLoopback = true;
                }),
                HasSubstr("not encrypted"));
    EXPECT_THAT(problem([](auto& a) { a.endpoint = "http://127.0.0.1/{user}"; }), HasSubstr("not encrypted"));
    EXPECT_THAT(problem([](auto& a) {
                    a.endpoint = "http://127.0.0.1/{user}";
                    a.plainLoopback = true;
                }),
                HasSubstr("https endpoint"));
    EXPECT_EQ(problem([](auto& a) {
                  a.endpoint = "http://127.0.0.1:8/{user}";
                  a.secureEndpoint = "https://127.0.0.1:9/{user}";
                  a.plainLoopback = true;
              }),
              "");
    EXPECT_THAT(problem([](auto& a) { a.caFile = "/nonexistent"; }), HasSubstr("/nonexistent"));
    EXPECT_THAT(problem([](auto& a) { a.nameHost = "a/b"; }), HasSubstr("host name"));
    EXPECT_THAT(problem([](auto& a) { a.passwordSource.kind = PasswordSource::Kind::file; }), HasSubstr("file"));
}

TEST(Account, SecureRequestsOfAPlainStoreGoToItsSecureEndpoint) {
    CXDAVAccount a = sample();
    a.endpoint = "http://127.0.0.1:8/{user}";
    a.secureEndpoint = "https://127.0.0.1:9/{user}";
    a.plainLoopback = true;
    const Url name = a.baseLocationFor(a.user);
    EXPECT_EQ(a.endpointFor(name, false)->absoluteString(), "http://127.0.0.1:8/alice");
    EXPECT_EQ(a.endpointFor(name, true)->absoluteString(), "https://127.0.0.1:9/alice");
}

TEST(Account, ADamagedFileIsNamed) {
    TempHome home;
    std::ofstream(CXDAVAccount::defaultPath()) << "garbage";
    EXPECT_THROW(
        {
            try {
                CXDAVAccount::load();
            } catch (const CXException& e) {
                EXPECT_THAT(e.reason(), HasSubstr(CXDAVAccount::defaultPath()));
                throw;
            }
        },
        CXException);
}

TEST(Account, PasswordsComeFromTheirSources) {
    TempHome home;
    using Kind = PasswordSource::Kind;
    EXPECT_EQ(reasonOf({Kind::command, "echo 'open sesame'; echo second"}), "password: open sesame");
    EXPECT_THAT(reasonOf({Kind::command, "exit 3"}), HasSubstr("exit code 3"));
    std::ofstream(home / "pw") << "s3cret\n";
    chmod((home / "pw").c_str(), 0600);
    EXPECT_EQ(reasonOf({Kind::file, home / "pw"}), "password: s3cret");
    chmod((home / "pw").c_str(), 0644);
    EXPECT_THAT(reasonOf({Kind::file, home / "pw"}), HasSubstr("chmod 600"));
    EXPECT_THAT(reasonOf({Kind::file, home / "none"}), HasSubstr("cannot be read"));
    home.setVariable("CREDENTIALS_DIRECTORY", home.path());
    EXPECT_EQ(reasonOf({Kind::credential, "pw"}), "password: s3cret");
    EXPECT_THAT(reasonOf({Kind::credential, "../pw"}), HasSubstr("cannot be the name"));
    home.setVariable("CREDENTIALS_DIRECTORY", std::nullopt);
    EXPECT_THAT(reasonOf({Kind::credential, "pw"}), HasSubstr("LoadCredential"));
}

// What is the daemon's own, and what makes a shell run something else, is not the command's; a manager's session is.
TEST(Account, APasswordCommandGetsThePersonsEnvironmentWithoutWhatLeadsItAstray) {
    TempHome home;
    std::ofstream(home / "astray") << "echo astray\n";
    for (const auto& [name, value] :
         std::initializer_list<std::pair<const char*, std::string>>{{"LD_LIBRARY_PATH", "/nonexistent"},
                                                                    {"NOTIFY_SOCKET", "@somewhere"},
                                                                    {"LISTEN_FDS", "1"},
                                                                    {"LISTEN_PID", "1"},
                                                                    {"ENV", home / "astray"},
                                                                    {"BASH_ENV", home / "astray"},
                                                                    {"BASH_FUNC_echo%%", "() { printf astray; }"},
                                                                    {"GLIBC_TUNABLES", "glibc.malloc.check=0"},
                                                                    {"BW_SESSION", "a session"},
                                                                    {"SSH_AUTH_SOCK", "/run/agent"}})
        home.setVariable(name, value);
    const std::string all = reasonOf({PasswordSource::Kind::command, "env | tr '\\n' '|'"});
    for (const char* gone : {"LD_", "NOTIFY_SOCKET", "LISTEN_", "|ENV=", "BASH_ENV", "BASH_FUNC", "GLIBC_TUNABLES"})
        EXPECT_THAT(all, testing::Not(HasSubstr(gone)));
    for (const char* kept : {"BW_SESSION=a session", "SSH_AUTH_SOCK=/run/agent", "HOME="})
        EXPECT_THAT(all, HasSubstr(kept));
    const auto path = [&](const std::string& value) {
        home.setVariable("PATH", value);
        return reasonOf({PasswordSource::Kind::command, "echo \"$PATH\""});
    };
    EXPECT_EQ(path(".:/usr/bin::bin:/bin:"), "password: /usr/bin:/bin");
    EXPECT_EQ(path("."), "password: /usr/local/bin:/usr/bin:/bin");
}

TEST(Account, WhoHoldsAPasswordLeavesNoCoreFile) {
    using Kind = PasswordSource::Kind;
    const auto dumpableAfter = [](const PasswordSource& source) {
        const pid_t child = ::fork();
        if (child == 0) {
            ::prctl(PR_SET_DUMPABLE, 1, 0, 0, 0); // whatever was read here before
            (void)reasonOf(source);
            std::_Exit(::prctl(PR_GET_DUMPABLE, 0, 0, 0, 0));
        }
        int status = -1;
        ::waitpid(child, &status, 0);
        return WEXITSTATUS(status);
    };
    EXPECT_EQ(dumpableAfter({Kind::none, ""}), 1) << "the test would see nothing";
    EXPECT_EQ(dumpableAfter({Kind::command, "echo word"}), 0);
    TempHome home;
    std::ofstream(home / "pw") << "word\n";
    chmod((home / "pw").c_str(), 0600);
    EXPECT_EQ(dumpableAfter({Kind::file, home / "pw"}), 0);
}

TEST(Account, LoopbackIsToldByAddress) {
    for (const char* h : {"localhost", "127.0.0.1", "127.9.9.9", "::1"}) EXPECT_TRUE(isLoopbackHost(h)) << h;
    for (const char* h : {"localhost.example.org", "10.0.0.1", "1270.0.0.1", "", "::2"})
        EXPECT_FALSE(isLoopbackHost(h)) << h;
}

// What it starts in turn (an agent that stays, say) would be deaf to them for life.
TEST(Account, APasswordCommandHearsTheSignalsThatThisThreadDoesNot) {
    sigset_t all, before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before);
    const std::string answer = reasonOf({PasswordSource::Kind::command, "kill -TERM $$; echo still here"});
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    EXPECT_THAT(answer, testing::Not(HasSubstr("still here")));
}

TEST(NetworkController, LoopbackIsAlwaysReachableAndNoHostNever) {
    CXNetworkController controller;
    EXPECT_TRUE(controller.canReachAddress("localhost"));
    EXPECT_TRUE(controller.canReachAddress("127.0.0.1"));
    EXPECT_FALSE(controller.canReachAddress(""));
}

TEST(VersionMemory, KnowsWhatWasReadInAnotherRunAndForgetsDamage) {
    TempDirectory directory;
    const FileVersion v{EntityTag("\"a\""), Date(1000), 5};
    {
        VersionMemory m(directory / "v");
        m.read("u", v);
        m.save({7, 3});
    }
    VersionMemory again(directory / "v");
    EXPECT_TRUE(again.knows("u", v));
    EXPECT_TRUE(again.knows("u", {EntityTag("W/\"a\""), Date(1000), 5}));
    EXPECT_FALSE(again.knows("u", {EntityTag("\"b\""), Date(1000), 5}));
    EXPECT_FALSE(again.knows("w", v));
    std::filesystem::resize_file(directory / "v", 17);
    EXPECT_FALSE(VersionMemory(directory / "v").knows("u", v));
}

TEST(VersionMemory, CountsForTheDatabaseThatHasWhatWasReadAndNotForAnEarlierStateOfIt) {
    TempDirectory directory;
    const FileVersion v{EntityTag("\"a\""), Date(1000), 5};
    const VersionMemory::Owner then{7, 3};
    VersionMemory(directory / "unused").belongTo(then);
    {
        VersionMemory m(directory / "v");
        m.belongTo({7, 2});
        m.read("u", v);
        m.save(then);
    }
    const auto isKnownTo = [&](const VersionMemory::Owner& owner) {
        VersionMemory m(directory / "v");
        m.belongTo(owner);
        return m.knows("u", v);
    };
    EXPECT_TRUE(isKnownTo(then));
    EXPECT_TRUE(isKnownTo({7, 9})) << "a process was killed before it saved the memory";
    EXPECT_FALSE(isKnownTo({7, 2})) << "a backup that was put back";
    EXPECT_FALSE(isKnownTo({8, 3})) << "another database";
}

// All rows at once behind a longer head, and no end.
TEST(VersionMemory, ReadsTheFileOfAnEarlierVersionAndWritesItsOwn) {
    TempDirectory directory;
    const FileVersion v{EntityTag("\"a\""), Date(1000), 5};
    const VersionMemory::Owner owner{7, 3};
    {
        VersionMemory m(directory / "now");
        for (const char* url : {"u", "w"}) m.read(url, v);
        m.save(owner);
    }
    const std::string now = readFile(directory / "now");
    constexpr size_t kRow = 32, kHead = 12;
    const std::string end = now.substr(now.size() - kRow);
    const std::string rows = now.substr(kHead, now.size() - kHead - kRow);
    std::ofstream(directory / "v", std::ios::binary)
        << "RVM3" << end.substr(0, 8) << end.substr(16, 8) << now.substr(4, 8) << rows;
    {
        VersionMemory m(directory / "v");
        m.belongTo(owner);
        EXPECT_TRUE(m.knows("u", v) && m.knows("w", v));
        m.read("x", v);
        m.save({7, 4});
    }
    VersionMemory again(directory / "v");
    again.belongTo({7, 4});
    EXPECT_TRUE(again.knows("u", v) && again.knows("w", v) && again.knows("x", v));
    EXPECT_TRUE(readFile(directory / "v").starts_with("RVM4"));
    std::ofstream(directory / "v", std::ios::binary) << "RVM3 and no more";
    EXPECT_FALSE(VersionMemory(directory / "v").knows("u", v));
}

TEST(VersionMemory, GoesBackToWhatWasSavedLast) {
    TempDirectory directory;
    const FileVersion v{EntityTag("\"a\""), Date(1000), 5};
    VersionMemory m(directory / "v");
    m.read("saved", v);
    m.save({7, 3});
    m.read("not saved", v);
    m.revert();
    EXPECT_TRUE(m.knows("saved", v));
    EXPECT_FALSE(m.knows("not saved", v));
}

TEST(VersionMemory, ASaveWritesWhatHasChangedAndNotTheWhole) {
    TempDirectory directory;
    const auto version = [](int i) { return FileVersion{EntityTag("\"" + std::to_string(i) + "\""), {}, 5}; };
    VersionMemory m(directory / "v");
    for (int i = 0; i < 10000; ++i) m.read(std::to_string(i), version(i));
    m.save({7, 1});
    const auto whole = std::filesystem::file_size(directory / "v");
    for (int pass = 2; pass < 100; ++pass) {
        m.read("edited", version(pass));
        if (pass == 50) m.forget("17");
        m.save({7, static_cast<uint64_t>(pass)});
    }
    EXPECT_LT(std::filesystem::file_size(directory / "v") - whole, 100u * 3 * 32);
    VersionMemory again(directory / "v");
    again.belongTo({7, 99});
    EXPECT_TRUE(again.knows("edited", version(99)));
    EXPECT_FALSE(again.knows("edited", version(98)));
    EXPECT_FALSE(again.remembers("17"));
    EXPECT_EQ(again.count(), 10000u);
}

TEST(VersionMemory, TheFileOfManyChangesStaysSmall) {
    TempDirectory directory;
    VersionMemory m(directory / "v");
    for (uint64_t pass = 1; pass < 5000; ++pass) {
        m.read("edited", {EntityTag("\"" + std::to_string(pass) + "\""), {}, 5});
        m.save({7, pass});
    }
    EXPECT_LT(std::filesystem::file_size(directory / "v"), 70u << 10);
    EXPECT_TRUE(VersionMemory(directory / "v").knows("edited", {EntityTag("\"4999\""), {}, 5}));
}

TEST(VersionMemory, ASaveThatIsNotThereToItsEndHasNotBeen) {
    TempDirectory directory;
    const FileVersion one{EntityTag("\"1\""), {}, 5}, two{EntityTag("\"2\""), {}, 5};
    {
        VersionMemory m(directory / "v");
        m.read("u", one);
        m.save({7, 1});
        m.read("u", two);
        m.read("w", two);
        m.save({7, 2});
    }
    const auto whole = std::filesystem::file_size(directory / "v");
    const std::string text = readFile(directory / "v");
    for (uintmax_t size = whole - 1; size > whole - 3 * 32; --size) {
        writeFileDurably(directory / "v", text.substr(0, size));
        VersionMemory m(directory / "v");
        EXPECT_TRUE(m.knows("u", one)) << size;
        EXPECT_FALSE(m.remembers("w")) << size;
        m.read("x", one); // and what follows is saved
        m.save({7, 3});
        EXPECT_TRUE(VersionMemory(directory / "v").knows("x", one)) << size;
        EXPECT_TRUE(VersionMemory(directory / "v").knows("u", one)) << size;
    }
    std::string damaged = text;
    damaged[whole - 40] ^= 1;
    writeFileDurably(directory / "v", damaged);
    EXPECT_TRUE(VersionMemory(directory / "v").knows("u", one));
}

TEST(VersionMemory, TwoProcessesDoNotWriteIntoEachOthersSaves) {
    TempDirectory directory;
    const FileVersion v{EntityTag("\"1\""), {}, 5};
    VersionMemory a(directory / "v"), b(directory / "v");
    a.read("a", v);
    a.save({7, 1});
    b.read("b", v);
    b.save({7, 2});
    a.read("c", v);
    a.save({7, 3});
    VersionMemory now(directory / "v");
    EXPECT_TRUE(now.knows("a", v) && now.knows("c", v)) << "the last one's memory stands";
}

TEST(VersionMemory, WhatIsOfAnotherStateOfTheDatabaseDoesNotComeBackWithALaterOne) {
    TempDirectory directory;
    const FileVersion v{EntityTag("\"1\""), {}, 5};
    {
        VersionMemory m(directory / "v");
        m.read("u", v);
        m.save({7, 3});
    }
    {
        VersionMemory m(directory / "v");
        m.belongTo({7, 2}); // a backup was put back
        EXPECT_FALSE(m.knows("u", v));
        m.save({7, 3});
    }
    VersionMemory m(directory / "v");
    m.belongTo({7, 4});
    EXPECT_FALSE(m.knows("u", v));
}

TEST(VersionMemory, WhatIsOfAnotherStateOfTheDatabaseIsGoneThoughNothingWasAskedNorSaved) {
    TempDirectory directory;
    const FileVersion v{EntityTag("\"1\""), {}, 5};
    {
        VersionMemory m(directory / "v");
        m.read("u", v);
        m.save({7, 3});
    }
    VersionMemory(directory / "v").belongTo({7, 2}); // a backup was put back, and the store is away
    VersionMemory m(directory / "v");
    m.belongTo({7, 3}); // that pass counts
    EXPECT_FALSE(m.knows("u", v));
}

TEST(VersionMemory, AWriteWithoutATagIsKnownBySizeAndServerDate) {
    VersionMemory m;
    m.wrote("u", EntityTag(), Date(1000), "hello");
    EXPECT_FALSE(m.knows("u", {EntityTag("\"x\""), Date(1002), 5}));
    EXPECT_FALSE(m.knows("u", {EntityTag("\"x\""), Date(1000), 6}));
    EXPECT_TRUE(m.knows("u", {EntityTag("\"x\""), Date(999), 5}));
    EXPECT_FALSE(m.knows("u", {EntityTag("\"y\""), Date(1000), 5})) << "once its tag is known, only that";
}

TEST(VersionMemory, AWriteWithoutATagIsKnownByTheDigestThatAListingTells) {
    VersionMemory m;
    const EntityTag ours("\"qvTGHdzF6KLavt4PO0gs2a6pQ00=\""), theirs("\"ZjGdowYmVGmkEvPd+SCZZXpTMWE=\"");
    m.wrote("u", EntityTag(), Date(1000), "hello");
    EXPECT_FALSE(m.knows("u", {theirs, Date(1000), 5})) << "another's, of our size and second";
    EXPECT_TRUE(m.knows("u", {ours, Date(2000), 5})) << "whatever date it has";
    EXPECT_FALSE(m.knows("u", {theirs, Date(1000), 5}));
}

TEST(VersionMemory, IsBounded) {
    VersionMemory m({}, 10);
    for (int i = 0; i < 100; ++i) m.read(std::to_string(i), {EntityTag("\"a\""), {}, 0});
    EXPECT_EQ(m.count(), 10u);
}

} // namespace
} // namespace rolvane
