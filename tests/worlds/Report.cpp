#include "Report.h"

#include <csignal>
#include <cstdlib>
#include <unistd.h>

namespace rolvane::worlds {

namespace {

std::string oneLine(std::string text) {
    for (char& c : text)
        if (c == '\n' || c == '\t') c = ' ';
    return text;
}

} // namespace

void Report::send(const std::string& lines) {
    std::string bytes;
    for (size_t from = 0, end = 0; from < lines.size(); from = end) {
        end = lines.find('\n', from) + 1;
        bytes += _whose + lines.substr(from, end - from);
    }
    const std::lock_guard guard(_mutex);
    for (size_t sent = 0; sent < bytes.size();) {
        const ssize_t n = ::write(_descriptor, bytes.data() + sent, bytes.size() - sent);
        if (n <= 0) ::_exit(EXIT_FAILURE); // nobody listens any more
        sent += static_cast<size_t>(n);
    }
}

void Report::line(char kind, std::string_view text) {
    send(std::string(1, kind) + "\t" + oneLine(std::string(text)) + "\n");
}

void Report::deed(const Deed& deed) {
    send(std::string(1, lines::kDeed) + "\t" + std::to_string(static_cast<int>(deed.kind)) + "\t" + deed.who + "\t" +
         deed.thing + "\t" + deed.cell + "\t" + deed.before + "\t" + deed.after + "\n");
}

void Report::view(const View& view) {
    std::string all;
    for (const auto* records : {&view.people, &view.groups})
        for (const auto& [name, cells] : *records) {
            all += std::string(1, records == &view.people ? lines::kPerson : lines::kGroup) + "\t" + name + "\n";
            for (const auto& [cell, value] : cells)
                all += std::string(1, lines::kCell) + "\t" + name + "\t" + cell + "\t" + value + "\n";
        }
    for (const auto& [name, text] : view.whole)
        all += std::string(1, lines::kWhole) + "\t" + name + "\t" + oneLine(text) + "\n";
    for (const std::string& fault : view.faults) all += std::string(1, lines::kWrong) + "\t" + oneLine(fault) + "\n";
    send(all);
}

void Report::die(std::string_view where) {
    // The edit may wait for a lock on the file that this very thread is writing to.
    const std::unique_lock guard(_whole, std::try_to_lock);
    if (!guard) return;
    line(lines::kKilled, where);
    ::kill(::getpid(), SIGKILL);
    ::_exit(EXIT_FAILURE);
}

std::vector<std::string> fieldsOf(std::string_view line) {
    std::vector<std::string> fields;
    for (size_t from = 2; from <= line.size();) {
        const size_t end = std::min(line.find('\t', from), line.size());
        fields.emplace_back(line.substr(from, end - from));
        from = end + 1;
    }
    return fields;
}

Deed deedOf(const std::vector<std::string>& f) {
    return {static_cast<Deed::Kind>(std::stoi(f.at(0))), f.at(1).at(0), f.at(2), f.at(3), f.at(4), f.at(5)};
}

void readViewLine(char kind, const std::vector<std::string>& f, View& into) {
    if (kind == lines::kPerson) into.people[f.at(0)];
    if (kind == lines::kGroup) into.groups[f.at(0)];
    if (kind == lines::kCell) (into.people.contains(f.at(0)) ? into.people : into.groups)[f.at(0)][f.at(1)] = f.at(2);
    if (kind == lines::kWhole) into.whole[f.at(0)] = f.at(1);
    if (kind == lines::kWrong) into.faults.push_back(f.at(0));
}

} // namespace rolvane::worlds
