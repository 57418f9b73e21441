// The part of a world that is about the owner's second computer.

#include "World.h"

#include "contacts/database/DaemonMemory.h"
#include "engine/memory/RightsTakenBack.h"
#include "foundation/Preferences.h"
#include "model/Computers.h"
#include "store/dav/CXDAVManager.h"

#include <filesystem>

namespace rolvane::worlds {

namespace {

namespace fs = std::filesystem;

CXMutableMultiValue listOf(const std::vector<std::string>& users) {
    CXMutableMultiValue values;
    for (const std::string& user : users) values.addValue(user, user);
    return values;
}

std::vector<std::string> usersIn(CXRolvane& database, const char* property) {
    std::vector<std::string> users;
    if (const auto listed = database.allGroup()->multiValueForProperty(property))
        for (const auto& entry : listed->entries()) users.push_back(entry.value.string());
    return users;
}

std::set<std::string> setOf(const std::vector<std::string>& users) {
    return {users.begin(), users.end()};
}

std::string joined(const std::set<std::string>& users) {
    std::string text;
    for (const std::string& user : users) text += user + " ";
    return text;
}

} // namespace

std::string World::readerOf(char role) {
    return (role == 'o' ? "x" : "y") + person(role).account.user.str().substr(1);
}

void World::makeSecondComputer() {
    _joinsAt = _chance.between(1, 6);
    for (const char role : {'o', 's'}) {
        _mayRead[role] = false;
        _store.addUser(readerOf(role), person(role).password);
    }
}

// Some have contacts there already.
void World::beginSecondComputer() {
    if (!_chance.happens(0.5)) return;
    const size_t people = _chance.between(1, 3), groups = _chance.below(2);
    inProcess("beginning", 's', [&](Report& report) {
        CXRolvane database(CXRolvane::Options{.path = person('s').database(), .program = "rolvane"});
        Editor('s', database, {}, hashOf("second", _seed), "0", report).makeAtFirst(people, groups);
    });
}

// As the command does it.
void World::join() {
    _hasJoined = true;
    const bool firstKnows = _chance.happens(0.5);
    const auto preferencesOf = [](const Person& each) {
        return Preferences(each.directory + "/preferences.db", daemonMemory(each.database()));
    };
    if (firstKnows)
        inProcess("telling", 'o', [&](Report&) {
            Preferences preferences = preferencesOf(person('o'));
            becomeOneOfSeveral(preferences);
        });
    inProcess("joining", 's', [&](Report& report) {
        const Person& here = person('s');
        CXRolvane database(CXRolvane::Options{.path = here.database(), .program = "rolvane"});
        Preferences preferences = preferencesOf(here);
        CXDAVManager store(here.account, signedIn(here));
        std::vector<std::string> readers, writers;
        if (!store.ACLsAtURL(here.tree, readers, writers)) report.line(lines::kWrong, "no lists are shown");
        becomeOneOfSeveral(preferences);
        database.allGroup()->setValue(listOf(readers), kCXReadSharingACLProperty);
        database.allGroup()->setValue(listOf(writers), kCXReadWriteSharingACLProperty);
        CXMutableMultiValue where;
        where.addValue(here.tree.absoluteString(), kCXPublishLabel);
        database.allGroup()->setValue(where, kCXRemoteLocationProperty);
        database.save();
    });
    _wrote.clear();
    Weather today = weather();
    today.ownTree = "/dav/" + person('s').account.user.str() + "/";
    inProcess("first daemon", 's', [&](Report& report) {
        endureOnDisk(today, report);
        Daemon(person('s'), today, report).pass();
    });
    for (const std::string& write : _wrote) _wrong.push_back("joining has written: " + write);
    // Until all is taken in the store's state holds here, whatever is edited meanwhile.
    for (int pass = 0; pass < 2; ++pass) clean('s');
    // The first computer finds out with a full pass. What it sends before may be written over what the other one sent.
    if (!firstKnows) clean('o');
}

bool World::hasStepOfItsOwn(const std::string& stamp) {
    if (!_hasJoined) return false;
    const char role = _chance.happens(0.5) ? 'o' : 's';
    if (_chance.happens(0.15) && with("sides")) {
        ++_outcome.sideBySide;
        const Weather here = weather(), there = weather();
        serve({{'o', _chance.next(), here}, {'s', _chance.next(), there}}, stamp);
        return true;
    }
    if (_chance.happens(0.12) && with("backups")) {
        _kept.contains(role) ? putBack(role) : keep(role);
        return true;
    }
    if (_chance.happens(0.06) && with("rights")) {
        changeRights(role);
        return true;
    }
    return false;
}

// Former states -------------------------------------------------------------------------------------------------------

void World::keep(char role) {
    tell("== state of " + std::string(1, role) + " is kept");
    const std::string kept = person(role).directory + ".kept";
    fs::remove_all(kept);
    fs::copy(person(role).directory, kept, fs::copy_options::recursive);
    _kept[role] = {_model.unsettled(selfOf(role)), _rightsToSend.contains(role)};
}

// The database alone, or the whole home. What was sent by then is on the store, and counts; where something was left
// the person has taken it back. Whoever edits there now has not seen what that computer did since: the model takes it
// for somebody else. What had not been sent in that state is sent a second time, as no store tells that it was there.
void World::putBack(char role) {
    const bool alone = _chance.happens(0.5);
    _settled.erase(role);
    _afterRest = true;
    for (int pass = 0; pass < 3; ++pass) clean(role); // a tree that is taken in first needs two
    _afterRest = false;
    if (!_settled.contains(role)) {
        _model.refused(selfOf(role));
        _mayRead[role] = std::nullopt;
    }
    tell("== " + std::string(alone ? "database" : "home") + " of " + role + " is put back");
    const std::string here = person(role).directory, kept = here + ".kept";
    for (const auto& entry : fs::directory_iterator(here))
        if (!alone || entry.path().filename().string().starts_with("contacts.db")) fs::remove_all(entry.path());
    for (const auto& entry : fs::directory_iterator(kept))
        if (!alone || entry.path().filename().string().starts_with("contacts.db"))
            fs::copy(entry.path(), here / entry.path().filename(), fs::copy_options::recursive);
    fs::remove_all(kept);
    _selves[role] = static_cast<char>('0' + ++_outcome.restored);
    _model.comeBack(_kept[role].deeds, _selves[role]);
    if (_kept[role].rights) _mayRead[role] = std::nullopt;
    _kept.erase(role);
}

// Rights --------------------------------------------------------------------------------------------------------------

// The person takes a right that this computer shows, and grants one that it does not: another former state shows
// others.
void World::changeRights(char role) {
    View shown;
    inProcess(
        "looking at rights", role,
        [&](Report& report) {
            CXRolvane database(CXRolvane::Options{.path = person(role).database(), .program = "rolvane"});
            View view;
            view.whole["readers"] = joined(setOf(usersIn(database, kCXReadSharingACLProperty)));
            report.view(view);
        },
        &shown);
    std::optional<bool>& mayRead = _mayRead[role];
    mayRead = (" " + shown.whole["readers"]).find(" " + readerOf(role) + " ") == std::string::npos;
    _rightsToSend.insert(role);
    inProcess(*mayRead ? "sharing" : "unsharing", role, [&](Report&) {
        if (!*mayRead) { // on the store first, as the command does it
            CXDAVManager store(person(role).account, signedIn(person(role)));
            std::vector<std::string> there, writers;
            store.ACLsAtURL(person(role).tree, there, writers);
            std::erase(there, readerOf(role));
            store.setACLsWithReadPrincipals(there, writers, person(role).tree);
        }
        CXRolvane database(CXRolvane::Options{.path = person(role).database(), .program = "rolvane"});
        std::vector<std::string> readers = usersIn(database, kCXReadSharingACLProperty);
        std::erase(readers, readerOf(role));
        if (*mayRead) readers.push_back(readerOf(role));
        database.allGroup()->setValue(listOf(readers), kCXReadSharingACLProperty);
        database.save();
        if (*mayRead) return;
        Preferences preferences(person(role).directory + "/preferences.db", daemonMemory(person(role).database()));
        forgetRightTakenBack(preferences, readerOf(role), true);
    });
}

std::vector<std::string> World::wrongRights() {
    View seen;
    inProcess(
        "rights", 'o',
        [&](Report& report) {
            CXDAVManager store(person('o').account, signedIn(person('o')));
            std::vector<std::string> readers, writers;
            View view;
            if (!store.ACLsAtURL(person('o').tree, readers, writers)) view.faults.push_back("no lists are shown");
            view.whole["store"] = joined(setOf(readers)) + "| " + joined(setOf(writers));
            report.view(view);
        },
        &seen);
    for (const char role : {'o', 's'})
        inProcess(
            "rights", role,
            [&](Report& report) {
                CXRolvane database(CXRolvane::Options{.path = person(role).database(), .program = "rolvane"});
                const auto readers = usersIn(database, kCXReadSharingACLProperty),
                           writers = usersIn(database, kCXReadWriteSharingACLProperty);
                View view;
                view.whole[std::string(1, role)] = joined(setOf(readers)) + "| " + joined(setOf(writers));
                report.view(view);
            },
            &seen);
    std::vector<std::set<std::string>> allowed{{person('w').account.user.str(), person('r').account.user.str()}};
    for (const char role : {'o', 's'}) {
        std::vector<std::set<std::string>> further;
        for (const std::set<std::string>& each : allowed) {
            if (_mayRead[role] != true) further.push_back(each);
            if (_mayRead[role] == false) continue;
            further.push_back(each);
            further.back().insert(readerOf(role));
        }
        allowed = further;
    }
    std::vector<std::string> wrong;
    for (const auto& [where, lists] : seen.whole) {
        bool found = false;
        for (const std::set<std::string>& each : allowed)
            found |= lists == joined(each) + "| " + joined({person('w').account.user.str()});
        if (!found || lists != seen.whole["store"]) wrong.push_back("lists at " + where + " are " + lists);
    }
    return wrong;
}

} // namespace rolvane::worlds
