#pragma once

#include "contacts/database/CXRolvane.h"
#include "support/TempHome.h"

#include <functional>
#include <memory>
#include <string>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

namespace rolvane::test {

// A contact database in a directory of its own, with a clock and a notification centre of its own.
struct TestDatabase {
    TempDirectory directory;
    ManualClock clock{Date(1700000000)};
    NotificationCenter center;
    std::string path = directory / "data/contacts.db";
    std::unique_ptr<CXRolvane> database = open();

    CXRolvane::Options options(const std::string& program = "RolvaneManager") {
        CXRolvane::Options o;
        o.path = path;
        o.program = program;
        o.clock = &clock;
        o.center = &center;
        return o;
    }
    std::unique_ptr<CXRolvane> open(const std::string& program = "RolvaneManager") {
        return std::make_unique<CXRolvane>(options(program));
    }
    void reopen() {
        database.reset();
        database = open();
    }
    CXRolvane* operator->() { return database.get(); }
    CXRolvane& operator*() { return *database; }

    CXPersonRef addPerson(const std::string& first, const std::string& uid = {}) {
        return addPersonTo(*database, first, uid);
    }
    static CXPersonRef addPersonTo(CXRolvane& database, const std::string& first, const std::string& uid = {}) {
        CXPersonRef person = uid.empty() ? CXPerson::create() : CXPerson::initWithUniqueId(UniqueId(uid));
        person->setValue(first, kCXFirstNameProperty);
        database.addRecord(person);
        return person;
    }
    CXGroupRef addGroup(const std::string& name, const std::string& uid = {}) {
        CXGroupRef group = uid.empty() ? CXGroup::create() : CXGroup::initWithUniqueId(UniqueId(uid));
        group->setValue(name, kCXGroupNameProperty);
        database->addRecord(group);
        return group;
    }
    CXPersonRef addSubscribedPerson(const std::string& first, const std::string& location) {
        CXPersonRef person = CXPerson::initWithUniqueId(makeUniqueId(kCXSubscribedPersonTable));
        person->setValue(first, kCXFirstNameProperty);
        person->setValue(from(location), kCXRemoteLocationProperty);
        database->addRecord(person);
        return person;
    }
    static CXMultiValue from(const std::string& location) {
        CXMutableMultiValue where;
        where.addValue(location, kCXSubscribeLabel);
        return where;
    }
};

// Runs the work in a process of its own, which then ends without any clean-up; gives its exit status (the work's
// result), or 128 + signal. An exception in it is told on standard error and gives 99.
inline int inProcess(const std::function<int()>& work) {
    pid_t child = ::fork();
    if (child == 0) {
        int result = 99;
        try {
            result = work();
        } catch (const std::exception& e) {
            (void)!::write(2, e.what(), std::char_traits<char>::length(e.what()));
            (void)!::write(2, "\n", 1);
        }
        ::_exit(result);
    }
    int status = 0;
    while (::waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

inline std::vector<std::string> texts(const std::vector<UniqueId>& uids) {
    std::vector<std::string> all;
    for (const UniqueId& uid : uids) all.push_back(uid.str());
    return all;
}

inline std::vector<std::string> names(const std::vector<CXPersonRef>& people) {
    std::vector<std::string> all;
    for (const auto& p : people) all.push_back(p->valueForProperty(kCXFirstNameProperty).string());
    return all;
}

// The reason of the database's exception that the work throws; "" when it throws none.
inline std::string reasonOf(const std::function<void()>& work) {
    try {
        work();
    } catch (const CXException& e) {
        EXPECT_EQ(e.name(), kCXDatabaseException);
        return e.reason();
    }
    return "";
}

#define EXPECT_TELLS(text, part) EXPECT_NE((text).find(part), std::string::npos) << (text)

} // namespace rolvane::test
