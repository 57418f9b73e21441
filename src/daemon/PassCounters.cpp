#include "daemon/PassCounters.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Paths.h"

#include <fmt/format.h>

namespace rolvane {

namespace {

void metric(std::string& text, const char* name, const char* type, const char* help) {
    text += fmt::format("# HELP rolvane_{0} {2}\n# TYPE rolvane_{0} {1}\n", name, type, help);
}

void value(std::string& text, const std::string& name, double number) {
    text += fmt::format("rolvane_{} {}\n", name, number);
}

} // namespace

PassCounters::PassCounters(std::string path, Date started) : _path(std::move(path)), _started(started) {}

std::string PassCounters::defaultPath() {
    return stateDirectory() + "/metrics.prom";
}

void PassCounters::add(Direction& to, const PassDirection& of) const {
    to.carried += of.carried;
    to.refused += of.refused;
    to.waiting += of.waiting;
}

void PassCounters::passEnded(const PassOutcome& outcome) {
    ++(outcome.full ? _full : _small);
    if (!isComplete(outcome)) ++_incomplete;
    if (!outcome.storeReached) ++_unreached;
    _out.waiting = _in.waiting = 0;
    for (const PassTree& tree : outcome.trees) {
        add(_out, tree.out);
        add(_in, tree.in);
    }
    _lastEnded = outcome.ended;
    _lastSeconds = outcome.ended.secondsSince(outcome.began);
    _reached = outcome.storeReached;
    _sent = everythingIsSent(outcome);
    try {
        writeFileWhole(_path, text());
        _told = false;
    } catch (const CXException& e) {
        if (!_told) CXLog("The counters could not be written: %@", e);
        _told = true;
    }
}

std::string PassCounters::text() const {
    std::string all;
    metric(all, "passes_total", "counter", "Passes that have ended. A full one looks at the database and all trees.");
    value(all, "passes_total{kind=\"full\"}", static_cast<double>(_full));
    value(all, "passes_total{kind=\"small\"}", static_cast<double>(_small));
    metric(all, "passes_incomplete_total", "counter", "Passes that an error or a full disk has ended.");
    value(all, "passes_incomplete_total", static_cast<double>(_incomplete));
    metric(all, "passes_without_store_total", "counter", "Passes to which the store did not answer.");
    value(all, "passes_without_store_total", static_cast<double>(_unreached));
    metric(all, "changes_total", "counter", "Change records that went out to the store, or came in.");
    value(all, "changes_total{direction=\"out\"}", static_cast<double>(_out.carried));
    value(all, "changes_total{direction=\"in\"}", static_cast<double>(_in.carried));
    metric(all, "changes_refused_total", "counter", "Change records that were given up.");
    value(all, "changes_refused_total{direction=\"out\"}", static_cast<double>(_out.refused));
    value(all, "changes_refused_total{direction=\"in\"}", static_cast<double>(_in.refused));
    metric(all, "changes_waiting", "gauge", "Change records that wait after the last pass.");
    value(all, "changes_waiting{direction=\"out\"}", static_cast<double>(_out.waiting));
    value(all, "changes_waiting{direction=\"in\"}", static_cast<double>(_in.waiting));
    metric(all, "store_reached", "gauge", "1 when the store answered in the last pass.");
    value(all, "store_reached", _reached);
    metric(all, "everything_sent", "gauge", "1 when the last pass left nothing to be sent, and nothing was refused.");
    value(all, "everything_sent", _sent);
    metric(all, "last_pass_timestamp_seconds", "gauge", "When the last pass ended.");
    value(all, "last_pass_timestamp_seconds", _lastEnded.secondsSince1970());
    metric(all, "last_pass_duration_seconds", "gauge", "How long it took.");
    value(all, "last_pass_duration_seconds", _lastSeconds);
    metric(all, "start_time_seconds", "gauge", "When the daemon was started: counters begin there.");
    value(all, "start_time_seconds", _started.secondsSince1970());
    return all;
}

} // namespace rolvane
