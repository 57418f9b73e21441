#pragma once

#include <map>
#include <set>
#include <string>
#include <vector>

namespace rolvane::worlds {

// One thing that one person did. `thing` is the identifier of a contact or group in its shared form.
struct Deed {
    enum class Kind { makePerson, makeGroup, remove, set };
    Kind kind;
    char who; // 'o' the owner, 'w' the writer; a computer of the owner's counts as somebody, see World::putBack
    std::string thing;
    std::string cell;          // of `set`: the part that was changed, see below
    std::string before, after; // what the person saw there, and what stands there now; "" for nothing
};

// Parts of a contact: "First" and the like, each a mark that was never used before; "Phone/<root>", one labelled value,
// known by the mark that it was made with. Parts of a group: "Name"; "Member/<contact>" and "Group/<group>", "1" or "".
using Cells = std::map<std::string, std::string>;

// What one copy of the tree holds.
struct View {
    std::map<std::string, Cells> people, groups;
    std::map<std::string, std::string> whole; // identifier -> everything of the record as text, to compare two copies
    std::vector<std::string> faults;          // what no copy may show: somebody who is listed twice, for instance
};

// What must be so in the end, from what each person did and saw while doing it. It knows nothing of how copies are kept
// in step:
//
// - Who was made is there; who was removed by anybody is not, whatever somebody else did to it meanwhile.
// - A part that was changed has a value that nobody has replaced knowingly. One person's later change replaces all that
//   person's earlier ones, and what the person saw. Where two changed the same part without knowing of each other, one
//   of both values stands. Labelled values are told apart by what they say: two such changes of one stand side by side.
// - A list names nobody who is not there, and what nobody made is nowhere.
//
// What a store was told to refuse once may have been carried out or not: see `refused`.
class Model {
public:
    void take(const Deed& deed);
    // All that the person did so far is on the store.
    void settled(char who);
    // The store has refused something of the person's, who is not the owner. What is not settled may stay or go.
    void refused(char who);
    // What the person did since the last settling, so that it may be on no store yet.
    std::vector<Deed> unsettled(char who) const;
    // A state comes back in which these deeds were not sent, and all of them have been since. `who` edits there now.
    // Nothing that is stored tells what became of them meanwhile, as no store keeps a note of whom it has lost:
    // - A contact or group that was made there may be there again, though somebody has removed it. So it may where
    //   somebody removes it before that computer has settled.
    // - A part has again the value that was given it there, or the one that has replaced it since.
    void comeBack(const std::vector<Deed>& unsent, char who);

    // What is wrong with the copy, a line each; nothing when all is well.
    std::vector<std::string> differences(const View& view) const;

    size_t deeds = 0, conflicts = 0; // conflicts: parts that two people changed without knowing of each other
    // Without: where both have edited one contact, only the copies must agree, on values that somebody wrote.
    bool mergesProperties = true;

private:
    struct Value {
        char who;
        std::string text;
    };
    struct Cell {
        std::vector<Value> heads;           // what nobody replaced knowingly
        std::map<std::string, int> history; // each value that ever stood here, and how often it was set
        bool anything = false;              // any of the history may stand here
    };
    struct Thing {
        bool isGroup = false;
        bool mayBeMissing = false, mayBeThere = false; // both: its making or its removal was refused
        bool removed = false, cameBack = false;
        std::set<char> editors;
        std::map<std::string, Cell> cells;
    };
    const Thing* known(const std::string& thing) const;
    bool mustBeAbsent(const std::string& thing) const;
    bool mayStand(const std::string& name, const Thing& thing, const std::string& cell, const std::string& value) const;
    bool couldCloseACircle(const std::string& outer, const std::string& inner) const;
    void judge(const std::string& name, const Thing& thing, const Cells* there, std::vector<std::string>& out) const;

    std::map<std::string, Thing> _things;
    std::map<char, std::vector<Deed>> _recent;             // since the last settling
    std::map<char, std::set<std::string>> _madeThereAgain; // things that came back, until the next settling
};

} // namespace rolvane::worlds
