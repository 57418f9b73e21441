#pragma once

#include "Participant.h"

#include "support/CapturingLog.h"

#include <algorithm>
#include <array>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <random>
#include <sys/stat.h>

namespace rolvane::test {

// Alice publishes three people and a group; Bob subscribes, and may write. Neither has made a pass by which anything
// of the other could arrive.
class TwoUsers : public testing::Test {
protected:
    static void SetUpTestSuite() { world = new StoreWorld; }
    static void TearDownTestSuite() {
        delete world;
        world = nullptr;
    }
    TwoUsers() {
        std::filesystem::remove_all(world->file());
        std::filesystem::remove_all(world->file("", "bob"));
        people = {alice.add("Ada"), alice.add("Ben"), alice.add("Cleo")};
        friends = alice.group("Friends", {people[0], people[2]});
        CXMutableMultiValue writers;
        writers.addValue("bob", "bob");
        // Who may write may read: the store says so, too, and a database that did not would take it back each time.
        for (const char* list : {kCXReadSharingACLProperty, kCXReadWriteSharingACLProperty})
            alice.application->allGroup()->setValue(writers, list);
        alice.publish();
        alice.pass();
        bob.subscribe(alice);
    }
    std::map<std::string, std::string> copies() { return bob.view(alice.base); }
    std::filesystem::path fileOf(const UniqueId& person) {
        return world->file("People/" + CXACLManager::bucketNameForUID(person) + "/" + person.str());
    }
    std::filesystem::path fileOf(const CXPersonRef& person) { return fileOf(person->uniqueId()); }
    static std::string textOf(const std::filesystem::path& file) {
        std::ifstream in(file, std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(in), {});
    }
    static Dictionary contentOf(const std::filesystem::path& file) {
        return PropertyList::fromXML(textOf(file)).dictionary();
    }
    // As another client of the store does: the file is replaced, and the server dates it.
    static void rewrite(const std::filesystem::path& file, const std::string& text) {
        const std::string fresh = file.string() + ".new";
        std::ofstream(fresh, std::ios::binary) << text;
        std::filesystem::rename(fresh, file);
    }
    // A first name that another client has written into the contact's file.
    void writeElsewhere(const CXPersonRef& person, const std::string& first) {
        Dictionary content = contentOf(fileOf(person)).mutableCopy();
        content.set(kCXFirstNameProperty, first);
        rewrite(fileOf(person), PropertyList::toXML(content));
    }
    static int64_t dateOf(const std::filesystem::path& file) {
        struct stat status {};
        EXPECT_EQ(::stat(file.c_str(), &status), 0) << file;
        return status.st_mtime;
    }
    static void setDate(const std::filesystem::path& file, int64_t seconds) {
        const std::array<timespec, 2> times{timespec{seconds, 0}, timespec{seconds, 0}};
        ASSERT_EQ(::utimensat(AT_FDCWD, file.c_str(), times.data(), 0), 0) << file;
    }
    static Value firstName(const CXPersonRef& person) { return person->valueForProperty(kCXFirstNameProperty); }
    // Nothing written, and nothing read but the listing and what is asked for it.
    static void expectQuietPass(Participant& user) {
        user.wire->clear();
        user.pass();
        EXPECT_EQ(user.writes(), 0u) << user.name << "\n" << user.wire->text();
        EXPECT_EQ(user.reads("People") + user.reads("CXGroup"), 0u) << user.name << "\n" << user.wire->text();
    }

    static inline StoreWorld* world = nullptr;
    CapturingLog log;
    Participant alice{*world, "alice"}, bob{*world, "bob"};
    std::vector<CXPersonRef> people;
    CXGroupRef friends;
};

} // namespace rolvane::test
