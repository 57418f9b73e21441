#pragma once

#include "Context.h"

#include "store/account/Account.h"

#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace rolvane::cli {

// One thing that was looked at.
struct Finding {
    enum class State {
        well,
        note,   // nothing is wrong, or not yet; the sentence says what to know
        failed, // the sentence says what is wrong, and a command what to do
        unknown // it could not be looked at, because something else has failed
    };
    std::string check; // a word for programs: "database"
    State state = State::well;
    std::string what; // a sentence for the person; may name anything
    std::string toDo; // a command, or a sentence where no command helps; "" when there is nothing to do
    // Figures for a report to strangers: numbers, booleans and null. Texts are left out of a report whatever they are.
    nlohmann::ordered_json figures = nlohmann::ordered_json::object();
};

// Looks at everything that sharing needs. Changes nothing here; on the store a folder is made and taken away again, as
// `account test` does it. Takes some seconds; a part that cannot be had keeps none of the others from being looked at.
class Doctor {
public:
    explicit Doctor(Context& context) : _context(context) {}
    std::vector<Finding> examine();

private:
    void add(Finding finding) { _found.push_back(std::move(finding)); }
    void attempt(const std::string& check, const std::string& command, const std::function<Finding()>& look);
    void examineFiles();
    void examineStore();
    void examineSystem();

    Finding database();
    Finding preferences();
    Finding account();
    Finding authority();
    Finding clock();
    Finding structure();
    Finding otherComputers();
    Finding bus();
    Finding daemon();
    Finding unit();
    Finding disk();
    Finding queue();
    void trial();

    Context& _context;
    std::vector<Finding> _found;
    std::optional<CXDAVAccount> _account;
    bool _databaseOpens = false, _storeAnswers = false, _sharesSomething = false;
};

const char* stateName(Finding::State state);
nlohmann::ordered_json findingsJson(const std::vector<Finding>& findings);
bool allWell(const std::vector<Finding>& findings); // nothing has failed

// A report for whoever helps: which checks failed, with their figures and the program's version. No text of a finding
// is in it, so no name, number, address or secret is. Pure.
nlohmann::ordered_json bundleOf(const std::vector<Finding>& findings, const std::string& version);

} // namespace rolvane::cli
