#include "LossRows.h"

#include <array>

namespace rolvane::board {

namespace {

struct Loss {
    const char* name;
    bool (*isLost)(const std::string& file, size_t number); // the number counts files of its kind
};

bool isContact(const std::string& file) {
    return file.ends_with(":CXPerson");
}
bool isGroup(const std::string& file) {
    return file.ends_with(":CXGroup");
}
bool isList(const std::string& file) {
    return file == "AllCXGroup";
}

constexpr std::array kLosses{
    Loss{"the list of everybody", [](const std::string& file, size_t) { return isList(file); }},
    Loss{"a group", [](const std::string& file, size_t number) { return isGroup(file) && number == 0; }},
    Loss{"another group", [](const std::string& file, size_t number) { return isGroup(file) && number == 1; }},
    Loss{"all groups", [](const std::string& file, size_t) { return isGroup(file); }},
    Loss{"a contact", [](const std::string& file, size_t number) { return isContact(file) && number == 0; }},
    Loss{"another contact", [](const std::string& file, size_t number) { return isContact(file) && number == 1; }},
    Loss{"all contacts", [](const std::string& file, size_t) { return isContact(file); }},
    Loss{"all contacts and their list",
         [](const std::string& file, size_t) { return isContact(file) || isList(file); }},
    Loss{"all contacts and groups", [](const std::string& file, size_t) { return isContact(file) || isGroup(file); }}};
constexpr size_t kKinds = kLosses.size();
constexpr size_t kRoles = 3, kRounds = 4, kCases = kKinds * kRoles * kRounds;

} // namespace

bool loseFilesOnce(Work& work, size_t number) {
    if (number >= kCases) return false;
    const size_t kind = number % kKinds;
    Stage& stage = work.stage;
    const Scenario scenario{"reader-later", Stage::kRoles[number / kKinds % kRoles], false};
    stage.forgetStory();
    stage.bringBack(scenario.name);
    (void)stage.pass('w'); // all three are in step then
    (void)stage.pass('r');
    const std::string name = kLosses[kind].name;
    stage.tell("   LOST " + name);
    stage.loseFromTree(kLosses[kind].isLost);
    const Ending ending = stage.pass(scenario.role);
    goOn(work, scenario, number);
    judge(work, name + ", noticed by " + scenario.role + ", number " + std::to_string(number), settlingOf(scenario),
          ending);
    return true;
}

void loseFiles(Work& work) {
    for (size_t number = 0; number < kCases && !work.timeIsOver(); ++number)
        if (work.isMine(number)) loseFilesOnce(work, number);
}

} // namespace rolvane::board
