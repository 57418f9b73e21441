// Names and contents that somebody has put into a published tree, on the disk of a real store, to do harm.

#include "TwoUsers.h"

namespace rolvane::test {

class HostileTree : public TwoUsers {
protected:
    static const inline std::string kSuffix = ":CXPerson";

    static std::filesystem::path bucket() { return world->file("People/3"); }
    std::string soundContact() { return PropertyList::toXML(contentOf(fileOf(people[0]))); }
    // Lines of the log since the last call that contain the text.
    size_t linesWith(const std::string& part) {
        const auto lines = log.lines();
        const auto from = lines.begin() + static_cast<std::ptrdiff_t>(_read);
        _read = lines.size();
        return static_cast<size_t>(std::count_if(
            from, lines.end(), [&](const std::string& line) { return line.find(part) != std::string::npos; }));
    }
    // What Alice publishes is with Bob, however the store looks; and what happens next travels both ways.
    void expectLifeGoesOn(size_t strangers = 0) {
        for (int i = 0; i < 2; ++i) {
            bob.pass();
            alice.pass();
        }
        EXPECT_EQ(copiesOfAlices(), alice.view()) << log.text();
        EXPECT_EQ(bob.countPeople(alice.base), 3 + strangers) << log.text();
        people[1]->setValue(Value("Benedict"), kCXFirstNameProperty);
        alice.application->save();
        alice.pass();
        bob.copyOf(people[0])->setValue(Value("Adalbert"), kCXFirstNameProperty);
        bob.application->save();
        for (Participant* each : {&bob, &alice, &bob, &alice}) each->pass();
        EXPECT_EQ(firstName(bob.copyOf(people[1])), Value("Benedict")) << log.text();
        EXPECT_EQ(firstName(people[0]), Value("Adalbert")) << log.text();
        EXPECT_EQ(copiesOfAlices(), alice.view()) << log.text();
        for (Participant* each : {&alice, &bob}) {
            EXPECT_TRUE(each->engine->getPendingChanges().empty()) << each->name;
            EXPECT_TRUE(each->alert.told.empty()) << each->name;
        }
    }
    // Bob's copies of what is in Alice's database; strangers are left out.
    std::map<std::string, std::string> copiesOfAlices() {
        auto all = copies();
        const auto ours = alice.view();
        std::erase_if(all, [&](const auto& entry) { return !ours.contains(entry.first); });
        return all;
    }
    Dictionary listOfEverybody() { return contentOf(listFile("AllCXGroup")); }
    static std::filesystem::path listFile(const std::string& name) {
        const std::filesystem::path place = world->file(name);
        return std::filesystem::is_directory(place) ? place / CXDAVManager::kStateName : place;
    }
    void addToList(const std::string& list, const char* key, const std::vector<Value>& names) {
        Dictionary state = Value(contentOf(listFile(list))).deepMutableCopy().dictionary();
        for (const Value& name : names) state.arrayFor(key).append(name);
        rewrite(listFile(list), PropertyList::toXML(state));
    }

private:
    size_t _read = 0;
};

TEST_F(HostileTree, FilesWithNamesThatMeanOtherPlacesOrNothingAreLeftOutWithOneLineAPass) {
    alice.pass();
    const std::vector<std::string> hostile{"..%2f..%2f..%2fbob%2fContacts%2fPeople%2f3%2fx" + kSuffix,
                                           ".." + kSuffix,
                                           "a\x01\x1f\x7f"
                                           "b" +
                                               kSuffix,
                                           "line\nbreak" + kSuffix,
                                           "not\xff\xfeutf8" + kSuffix,
                                           ".hidden" + kSuffix};
    for (int pass = 0; pass < 2; ++pass) {
        for (const std::string& name : hostile) std::ofstream(bucket() / name) << soundContact(); // told again
        bob.pass();
        EXPECT_EQ(linesWith("strange name"), hostile.size()) << log.text();
    }
    EXPECT_FALSE(std::filesystem::exists(world->file("People/3/x" + kSuffix, "bob")));
    expectLifeGoesOn();
}

TEST_F(HostileTree, NamesThatOnlyLookDangerousAreContactsLikeOthers) {
    alice.pass();
    const std::vector<std::string> names{"a%2fb" + kSuffix,
                                         "%2e%2e%2f" + kSuffix,
                                         "A B;C?D#E&F" + kSuffix,
                                         "\xc3\xa4\xe2\x82\xac" + kSuffix,
                                         std::string(246, 'n') + kSuffix,
                                         "TWIN" + kSuffix,
                                         "twin" + kSuffix};
    for (const std::string& name : names)
        std::ofstream(world->file("People/" + CXACLManager::bucketNameForUID(UniqueId(name)) + "/" + name))
            << PropertyList::toXML(Dictionary{{kCXFirstNameProperty, name}});
    bob.pass();
    for (const std::string& name : names) {
        const auto copy =
            bob.application->recordForUniqueId(cxUIDWithTableName(UniqueId(name), kCXSubscribedPersonTable));
        ASSERT_TRUE(copy) << name << "\n" << log.text();
        EXPECT_EQ(copy->valueForProperty(kCXFirstNameProperty), Value(name));
    }
    expectLifeGoesOn(names.size());
}

TEST_F(HostileTree, LinksFoldersAndTheTreesOwnNamesInABucketAreNoContacts) {
    alice.pass();
    TempDirectory secrets;
    std::ofstream(secrets / "secret") << PropertyList::toXML(Dictionary{{kCXFirstNameProperty, "Secret"}});
    std::filesystem::permissions(secrets.path(), std::filesystem::perms::all);
    std::filesystem::create_symlink(secrets / "secret", bucket() / ("link" + kSuffix));
    std::filesystem::create_symlink(secrets.path(), world->file("People/99"));
    std::filesystem::create_directory(bucket() / ("folder" + kSuffix));
    for (const char* name : {"info", "dateFile", "Contacts", "People", "AllCXGroup"})
        std::ofstream(bucket() / name) << soundContact();
    bob.pass();
    for (const CXListing& each : bob.application->listPeople(std::nullopt)) EXPECT_NE(each.displayName, "Secret");
    expectLifeGoesOn();
}

TEST_F(HostileTree, ContactFilesThatAreNoneAreToldOfOnceAndTheRestGoesOn) {
    alice.pass();
    std::string deep = "<?xml version=\"1.0\"?><plist version=\"1.0\">";
    for (int i = 0; i < 5000; ++i) deep += "<array>";
    for (int i = 0; i < 5000; ++i) deep += "</array>";
    deep += "</plist>";
    const std::string bomb = "<?xml version=\"1.0\"?><!DOCTYPE p [<!ENTITY a \"aaaaaaaaaa\"><!ENTITY b "
                             "\"&a;&a;&a;&a;&a;&a;&a;&a;\">]><plist version=\"1.0\"><dict><key>First</key><string>"
                             "&b;</string></dict></plist>";
    const std::vector<std::pair<std::string, std::string>> files{{"html", "<html>not a contact</html>"},
                                                                 {"empty", ""},
                                                                 {"deep", deep},
                                                                 {"bomb", bomb},
                                                                 {"list", PropertyList::toXML(Array{1})},
                                                                 {"zeros", std::string(1000, '\0')}};
    for (const auto& [name, text] : files)
        std::ofstream(
            world->file("People/" + CXACLManager::bucketNameForUID(UniqueId(name + kSuffix)) + "/" + name + kSuffix),
            std::ios::binary)
            << text;
    linesWith("");
    bob.pass();
    EXPECT_EQ(linesWith("is no dictionary"), files.size()) << log.text();
    bob.pass();
    EXPECT_EQ(linesWith("is no dictionary"), 0u) << "told once\n" << log.text();
    expectLifeGoesOn();
}

TEST_F(HostileTree, AContactFileThatIsTooLongCostsItselfAlone) {
    bob.pass();
    const std::string name = "huge" + kSuffix;
    const auto file = world->file("People/" + CXACLManager::bucketNameForUID(UniqueId(name)) + "/" + name);
    std::ofstream(file).close();
    std::filesystem::resize_file(file, HttpLimits().maxBodyBytes + 1); // a hole: it costs the store's disk nothing
    bob.wire->clear();
    bob.pass();
    EXPECT_EQ(linesWith("too large"), 1u) << log.text();
    EXPECT_EQ(bob.reads("huge"), 0u);
    people[1]->setValue(Value("Benedict"), kCXFirstNameProperty);
    alice.application->save();
    alice.pass();
    bob.pass();
    EXPECT_EQ(copies(), alice.view()) << log.text();
}

TEST_F(HostileTree, ListsThatNameOtherPlacesAreReadWithoutThoseNamesAndWithOneLineAList) {
    bob.pass();
    const std::vector<Value> hostile{Value("../../bob/Contacts/People/3/x" + kSuffix),
                                     Value("https://evil.example/dav/x" + kSuffix),
                                     Value(std::string(10240, 'x') + kSuffix),
                                     Value("line\nbreak" + kSuffix),
                                     Value("/etc/passwd"),
                                     Value("info"),
                                     Value("dateFile"),
                                     Value("People"),
                                     Value(""),
                                     Value(7),
                                     Value(Array{"a"})};
    addToList("AllCXGroup", "memberUIDState", hostile);
    addToList("AllCXGroup", "subgroupUIDState", hostile);
    addToList(friends->uniqueId().str(), "memberUIDState", hostile);
    for (int pass = 0; pass < 2; ++pass) {
        linesWith("");
        bob.wire->clear();
        bob.pass();
        EXPECT_EQ(linesWith("strange"), 2u) << log.text();
        for (const auto& exchange : bob.wire->exchanges()) {
            EXPECT_TRUE(exchange.path.starts_with("/dav/")) << exchange.path;
            EXPECT_EQ(exchange.path.find("%2F"), std::string::npos) << exchange.path;
            EXPECT_LT(exchange.path.size(), 1000u);
        }
    }
    expectLifeGoesOn();
    EXPECT_TRUE(contentOf(listFile("AllCXGroup"))["memberUIDState"].array().containsString("/etc/passwd"))
        << "what is not understood is left to whoever wrote it";
}

TEST_F(HostileTree, AListThatContainsItselfOrItsParentsEndsSomewhere) {
    bob.pass();
    const CXGroupRef other = alice.group("Other", {people[1]});
    alice.pass();
    const std::string a = friends->uniqueId().str(), b = other->uniqueId().str();
    addToList(a, "subgroupUIDState", {Value(b), Value(a), Value("AllCXGroup")});
    addToList(b, "subgroupUIDState", {Value(a)});
    for (Participant* each : {&bob, &alice, &bob, &alice}) each->pass();
    EXPECT_EQ(alice.countPeople(), 3u) << log.text();
    EXPECT_EQ(bob.countPeople(alice.base), 3u) << log.text();
    EXPECT_EQ(alice.application->listGroups(RemoteLocation()).size(), 2u);
    EXPECT_EQ(bob.application->listGroups(RemoteLocation(alice.base)).size(), 2u);
}

// -- rights that cannot be asked for

class RightsQuestion : public TwoUsers {
protected:
    // The question fails while it is true.
    std::atomic<bool> fails = false;
    RightsQuestion() {
        bob.wire->intercept([this](const HttpRequest& request) -> std::optional<HttpResponse> {
            const bool asks = request.method == "PROPFIND" && request.body &&
                              request.body->find("current-user-privilege-set") != std::string::npos;
            if (asks) ++asked;
            return asks && fails ? std::optional(answerOf(answer)) : std::nullopt;
        });
    }
    int answer = 500;
    std::atomic<int> asked = 0;
};

TEST_F(RightsQuestion, ThatFailsLosesNoEditAndNoCopy) {
    bob.pass();
    for (const int code : {500, 404, 401}) {
        answer = code;
        const std::string name = "Edit " + std::to_string(code);
        bob.copyOf(people[1])->setValue(Value(name), kCXFirstNameProperty);
        bob.application->save();
        fails = true;
        asked = 0;
        bob.pass();
        EXPECT_GT(asked, 0) << "nobody asked";
        EXPECT_EQ(firstName(bob.copyOf(people[1])), Value(name)) << log.text();
        fails = false;
        bob.pass();
        alice.pass();
        EXPECT_EQ(contentOf(fileOf(people[1]))[kCXFirstNameProperty], Value(name)) << log.text();
        EXPECT_EQ(firstName(people[1]), Value(name));
        EXPECT_EQ(copies(), alice.view());
        EXPECT_TRUE(bob.engine->getPendingChanges().empty());
        EXPECT_EQ(bob.preferences.get(kDaemonDomain, "CXDRefusedChanges").array().count(), 0u);
    }
}

TEST_F(RightsQuestion, ThatFailsWhileTheStoreTakesNoWritesLeavesTheEditsWaiting) {
    bob.pass();
    bob.copyOf(people[1])->setValue(Value("Benjamin"), kCXFirstNameProperty);
    bob.application->save();
    fails = true;
    bob.wire->intercept([this](const HttpRequest& request) -> std::optional<HttpResponse> {
        const bool writes = request.method == "PUT" && !request.url.encodedPath().ends_with("/dateFile");
        const bool asks = request.body && request.body->find("current-user-privilege-set") != std::string::npos;
        return fails && (writes || asks) ? std::optional(answerOf(503)) : std::nullopt;
    });
    for (int pass = 0; pass < 2; ++pass) {
        bob.pass();
        EXPECT_EQ(bob.engine->getPendingChanges().size(), 1u) << log.text();
    }
    fails = false;
    bob.pass();
    EXPECT_TRUE(bob.engine->getPendingChanges().empty());
    EXPECT_EQ(contentOf(fileOf(people[1]))[kCXFirstNameProperty], Value("Benjamin")) << log.text();
}

} // namespace rolvane::test
