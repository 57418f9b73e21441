#pragma once

#include "contacts/database/CXRolvane.h"
#include "engine/memory/EngineState.h"
#include "foundation/Preferences.h"

namespace rolvane {

// One commit of a pass, or of a part of it: contacts, queue, states, dates, cursor and share count reach the disk
// together, or nothing does. While it lives, whoever saves the database, moves its cursor or synchronises what the
// daemon remembers of it waits for `commit`. Destroyed without one, the values that were set are dropped; changed
// contacts stay unsaved. Everything is borrowed. Main thread.
class PassCommit {
public:
    PassCommit(CXRolvane& rolvane, Preferences& preferences, EngineState& state)
        : _state(state), _values(preferences), _commit(rolvane) {}
    ~PassCommit() {
        if (!_committed) _state.forgetPut();
    }
    PassCommit(const PassCommit&) = delete;
    PassCommit& operator=(const PassCommit&) = delete;

    void commit() { // throws CXException, and nothing is written
        _commit.commit(_values.changes());
        _values.end();
        _committed = true;
    }

private:
    EngineState& _state;
    Preferences::Hold _values;
    CXRolvane::OneCommit _commit;
    bool _committed = false;
};

} // namespace rolvane
