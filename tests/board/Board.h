#pragma once

#include "Judge.h"

#include <atomic>
#include <functional>
#include <string>
#include <vector>

namespace rolvane::board {

// What is counted of a row of the table, shared by the processes that work on it.
struct Count {
    std::atomic<size_t> cases = 0, failures = 0, late = 0;
    std::atomic<bool> cut = false; // the time was over before its end
};

// What a process of the board works on, and with.
struct Work {
    Stage& stage;
    Count& count;
    size_t job = 0, jobs = 1; // this one's number, and how many share the row
    size_t every = 1;         // only each so many-th case
    bool goesOn = true;       // people edit on between the fault and the clean passes
    std::function<bool()> timeIsOver;
    // Tells of a case that went wrong.
    std::function<void(const std::string& name, const std::vector<std::string>& wrong)> failed;
    std::function<void(const std::string& line)> told = [](const std::string&) {}; // what else there is to say
    std::vector<std::string> parts = {};                                           // to be left out; empty: all

    // True when the case with that number is this process's.
    bool isMine(size_t number) const { return number % every == stage.seed() % every && number / every % jobs == job; }
};

struct Row {
    std::string name;  // for --rows
    std::string fault; // as the table calls it
    void (*run)(Work& work);
    bool usesEntrance = false; // requests go through an entrance that can spoil them, which costs time
};

const std::vector<Row>& rows();

// The states from which a row begins, made once a stage; each is kept under a scenario's name.
struct Scenario {
    std::string name;
    char role;  // whose pass it is
    bool alone; // nobody else has a copy yet
};
const std::vector<Scenario>& scenarios();
void makeScenarios(Stage& stage);

Settling settlingOf(const Scenario& scenario);

// After the fault, before the clean passes: nobody does anything, or who was harmed edits on, or somebody else does.
void goOn(Work& work, const Scenario& scenario, size_t number);

// Ends a case, in which the harmed process ended so: true when nothing is wrong.
bool judge(Work& work, const std::string& name, const Settling& settling, const Ending& harmed);

} // namespace rolvane::board
