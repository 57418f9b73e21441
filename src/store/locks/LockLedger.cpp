#include "store/locks/LockLedger.h"

#include "foundation/CXException.h"
#include "foundation/Log.h"
#include "foundation/Mutex.h"
#include "foundation/Paths.h"
#include "store/locks/CXWebDAVLock.h"

#include <chrono>
#include <cstdio>
#include <filesystem>
#include <map>
#include <sstream>
#include <unistd.h>

namespace rolvane {

LockLedger LockLedger::user() {
    try {
        return LockLedger(stateDirectory() + "/locks");
    } catch (const CXException& e) {
        CXLog("Lock tokens are not written down: %@", e.reason());
        return LockLedger("");
    }
}

std::string LockLedger::pathFor(const std::string& url) const {
    uint64_t h = 0xcbf29ce484222325u;
    for (const char c : url) h = (h ^ static_cast<unsigned char>(c)) * 0x100000001b3u;
    char name[32];
    snprintf(name, sizeof name, "/%016llx", static_cast<unsigned long long>(h));
    return _directory + name;
}

namespace {

// When the process was started, in the kernel's ticks; "" when there is none, or only what a parent has not yet waited
// for. Together with the id it names a process for good.
std::string startOfProcess(const std::string& pid) {
    constexpr unsigned kExiting = 0x4; // PF_EXITING of the field "flags": it runs no more of its own code
    try {
        const std::string text = readFile("/proc/" + pid + "/stat", 65536);
        std::istringstream fields(text.substr(text.rfind(')') + 1));
        std::string state, field, start;
        unsigned flags = 0;
        fields >> state; // field 3
        for (int number = 4; number <= 8; ++number) fields >> field;
        fields >> flags; // field 9
        for (int number = 10; number <= 22; ++number) fields >> start;
        return !fields || state == "Z" || state == "X" || (flags & kExiting) != 0 ? "" : start;
    } catch (const CXException&) {
        return {};
    }
}

std::string thisProcess() {
    return std::to_string(getpid()) + " " + startOfProcess("self");
}

// Of what thisProcess() gave once.
bool isAlive(const std::string& process) {
    const size_t space = process.find(' ');
    return space != std::string::npos && startOfProcess(process.substr(0, space)) == process.substr(space + 1);
}

constexpr size_t kMarkLength = 36; // a UUID's

bool isAMark(const std::string& text) {
    return text.size() == kMarkLength && text.find_first_not_of("0123456789ABCDEFabcdef-") == std::string::npos;
}

// Marks of runs whose locks have all come to their end by now.
void removeOldRuns(const std::string& directory) {
    const auto old = std::filesystem::file_time_type::clock::now() -
                     std::chrono::duration_cast<std::chrono::seconds>(
                         std::chrono::duration<double>(2 * CXWebDAVLock::lockTimeout()));
    std::error_code failed;
    for (std::filesystem::directory_iterator run(directory, failed), end; !failed && run != end; run.increment(failed))
        try {
            std::error_code gone; // another program may be clearing up, too
            const auto written = run->last_write_time(gone);
            if (!gone && written < old && !isAlive(readFile(run->path(), 4096)))
                std::filesystem::remove(run->path(), gone);
        } catch (const CXException& e) {
            CXDLog("A run's file is left alone: %@", e.reason());
        }
}

} // namespace

std::string LockLedger::pathForRun(const std::string& mark) const {
    return _directory + "-runs/" + mark;
}

std::string LockLedger::markOfThisRun() const {
    static Mutex mutex;
    static std::map<std::pair<pid_t, std::string>, std::string> marks; // of a process that forked, too
    if (_directory.empty()) return {};
    const Lock guard(mutex);
    std::string& mark = marks[{getpid(), _directory}];
    if (!mark.empty() && access(pathForRun(mark).c_str(), R_OK) == 0) return mark;
    try {
        CXPathUtils_MakeCompletePath(_directory + "-runs", 0700);
        removeOldRuns(_directory + "-runs");
        mark = makeUUID();
        writeFileDurably(pathForRun(mark), thisProcess());
    } catch (const CXException& e) {
        CXDLog("A lock is not marked: %@", e.reason());
        mark.clear();
    }
    return mark;
}

bool LockLedger::isAnEndedRun(const std::string& owner) const {
    const std::string mark = owner.size() < kMarkLength ? "" : owner.substr(owner.size() - kMarkLength);
    if (_directory.empty() || !isAMark(mark) || access(pathForRun(mark).c_str(), R_OK) != 0) return false;
    try {
        return !isAlive(readFile(pathForRun(mark), 4096));
    } catch (const CXException&) {
        return false;
    }
}

namespace {

// The file: process id and start, URL and token, a line each.
struct Note {
    std::string process, url, token;
};

std::optional<Note> noteIn(const std::string& path) {
    if (access(path.c_str(), R_OK) != 0) return std::nullopt;
    try {
        const std::string text = readFile(path, 16384);
        const size_t first = text.find('\n'), second = text.find('\n', first + 1), third = text.find('\n', second + 1);
        if (third == std::string::npos) return std::nullopt;
        Note note{text.substr(0, first), text.substr(first + 1, second - first - 1),
                  text.substr(second + 1, third - second - 1)};
        return note.process.find(' ') == std::string::npos ? std::nullopt : std::optional(std::move(note));
    } catch (const CXException&) {
        return std::nullopt;
    }
}

} // namespace

void LockLedger::write(const std::string& url, const LockToken& token) {
    try {
        CXPathUtils_MakeCompletePath(_directory, 0700);
        // Not waited for: after a crash of the machine the lock ends by itself.
        writeFileWhole(pathFor(url), thisProcess() + "\n" + url + "\n" + token.str() + "\n");
    } catch (const CXException& e) {
        CXDLog("A lock token is not written down: %@", e.reason());
    }
}

bool LockLedger::expect(const std::string& url) {
    if (_directory.empty()) return false;
    const auto standing = noteIn(pathFor(url));
    // That of a killed run that knew its token, or of a living one.
    if (standing && standing->url == url && (!standing->token.empty() || isAlive(standing->process))) return false;
    write(url, {});
    return true;
}

void LockLedger::note(const std::string& url, const LockToken& token) {
    if (!_directory.empty()) write(url, token);
}

void LockLedger::strike(const std::string& url) {
    if (!_directory.empty()) ::unlink(pathFor(url).c_str());
}

std::optional<LockToken> LockLedger::orphan(const std::string& url) const {
    if (_directory.empty()) return std::nullopt;
    const auto note = noteIn(pathFor(url));
    if (!note || note->url != url || note->token.empty() || isAlive(note->process)) return std::nullopt;
    return LockToken(note->token);
}

std::vector<LockLedger::Left> LockLedger::leftByEndedRuns() const {
    std::vector<Left> left;
    std::error_code failed;
    if (_directory.empty()) return left;
    for (std::filesystem::directory_iterator file(_directory, failed), end; !failed && file != end;
         file.increment(failed))
        if (const auto note = noteIn(file->path()); note && !isAlive(note->process))
            left.push_back({note->url, LockToken(note->token)});
    return left;
}

} // namespace rolvane
