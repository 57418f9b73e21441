#pragma once

#include "engine/pass/PassOutcome.h"

#include <string>

namespace rolvane {

// The deeds of this process's passes, as a text file in the form that Prometheus reads (docs/formats.md):
// written whole at the end of each pass, without the name of anybody. Counters begin anew with each process. On the
// main thread.
class PassCounters {
public:
    PassCounters(std::string path, Date started);

    static std::string defaultPath(); // metrics.prom in the state directory

    // Notes the pass and writes the file. A file that cannot be written is logged once and tried again with the next
    // pass.
    void passEnded(const PassOutcome& outcome);
    std::string text() const;

private:
    struct Direction {
        int64_t carried = 0, refused = 0, waiting = 0; // `waiting` is of the last pass alone
    };
    void add(Direction& to, const PassDirection& of) const;

    const std::string _path;
    const Date _started;
    int64_t _full = 0, _small = 0, _incomplete = 0, _unreached = 0;
    Direction _out, _in;
    Date _lastEnded;
    double _lastSeconds = 0;
    bool _reached = false, _sent = false, _told = false;
};

} // namespace rolvane
