#include "server/mod_davacl/TreeJournal.h"

#include "server/mod_davacl/DirectoryIndex.h"
#include "server/mod_davacl/DiskMembers.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <filesystem>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <tuple>
#include <unistd.h>

namespace rolvane::davacl {
namespace {

using Kind = DirectoryIndex::Kind;
using Outcome = TreeJournal::Outcome;

constexpr uint64_t kMagic = 0x314c4e4a'4c564e52;      // says version 1, too
constexpr std::string_view kTemporary = ".davfs.tmp"; // what mod_dav_fs is receiving; it shows it to nobody
constexpr size_t kDeepest = 100;

// The journal's own file, locked while the object lives.
class Head {
public:
    Head(const std::string& directory, bool exclusive) {
        const std::string path = directory + "/head";
        _file = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
        if (_file < 0 && errno == ENOENT && exclusive && (mkdir(directory.c_str(), 0700) == 0 || errno == EEXIST))
            _file = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
        while (_file >= 0 && flock(_file, exclusive ? LOCK_EX : LOCK_SH) != 0)
            if (errno != EINTR) {
                close(_file);
                _file = -1;
            }
        std::array<uint64_t, 4> words{};
        _whole = _file >= 0 && pread(_file, words.data(), sizeof words, 0) == ssize_t{sizeof words} &&
                 words[0] == kMagic && words[3] == sumOf(words);
        if (_whole) {
            epoch = words[1];
            last = static_cast<int64_t>(words[2]);
        }
    }
    ~Head() {
        if (_file >= 0) close(_file);
    }
    Head(const Head&) = delete;
    bool isOpen() const { return _file >= 0; }
    bool isWhole() const { return _whole; }
    bool write() {
        std::array<uint64_t, 4> words{kMagic, epoch, static_cast<uint64_t>(last), 0};
        words[3] = sumOf(words);
        return pwrite(_file, words.data(), sizeof words, 0) == ssize_t{sizeof words};
    }
    // Every token that was given is worth nothing from now on.
    bool begin() {
        _whole = getrandom(&epoch, sizeof epoch, 0) == ssize_t{sizeof epoch} && write();
        return _whole;
    }
    uint64_t epoch = 0;
    int64_t last = 0;

private:
    static uint64_t sumOf(const std::array<uint64_t, 4>& words) {
        return textHash({reinterpret_cast<const char*>(words.data()), 3 * sizeof(uint64_t)}, 2);
    }
    int _file = -1;
    bool _whole = false;
};

struct DiskEntry {
    std::string name;
    Kind kind = Kind::file;
    bool isLink = false;
    uint64_t signature = 0, identity = 0;
    int64_t changed = 0;
};

struct DiskState {
    std::vector<DiskEntry> entries; // by name
    uint64_t sums[2] = {0, 0};
    int64_t newest = 0;
};

std::optional<DiskState> stateOf(int directory) {
    DiskState state;
    const bool whole = forEachDiskMember(directory, [&](const DiskMember& member) {
        if (!member.info || member.name.starts_with(kTemporary)) return;
        const bool isCollection = S_ISDIR(member.info->st_mode);
        if (!isCollection && !S_ISREG(member.info->st_mode)) return;
        DiskEntry entry{std::string(member.name), isCollection ? Kind::collection : Kind::file, member.isLink, 0, 0, 0};
        entry.signature = memberHash(member.name, *member.info, 0) + member.isLink;
        state.sums[0] += entry.signature;
        state.sums[1] += memberHash(member.name, *member.info, 1) + member.isLink;
        const uint64_t place[] = {member.info->st_dev, member.info->st_ino, member.isLink, isCollection};
        entry.identity = textHash({reinterpret_cast<const char*>(place), sizeof place});
        entry.changed = changeTime(*member.info);
        state.newest = std::max(state.newest, entry.changed);
        state.entries.push_back(std::move(entry));
    });
    if (!whole) return std::nullopt;
    std::sort(state.entries.begin(), state.entries.end(),
              [](const DiskEntry& a, const DiskEntry& b) { return a.name < b.name; });
    return state;
}

std::string hex(uint64_t number) {
    char text[24];
    std::snprintf(text, sizeof text, "/%016llx", static_cast<unsigned long long>(number));
    return text;
}

// The notes become the state of the disk; each difference gets the number.
void update(DirectoryIndex& index, const DiskState& disk, int64_t number) {
    std::vector<DirectoryIndex::Record> fresh;
    fresh.reserve(std::max(index.records.size(), disk.entries.size()));
    auto old = index.records.begin();
    const auto depart = [&](DirectoryIndex::Record& record) {
        if (record.kind != Kind::gone) {
            record.number = number;
            record.signature = record.identity = 0;
            record.appeared = 0;
        }
        record.kind = Kind::gone;
        fresh.push_back(std::move(record));
    };
    for (const DiskEntry& entry : disk.entries) {
        while (old != index.records.end() && old->name < entry.name) depart(*old++);
        DirectoryIndex::Record record;
        if (old != index.records.end() && old->name == entry.name) record = std::move(*old++);
        if (record.kind != entry.kind || record.identity != entry.identity) record.appeared = number;
        if (record.kind != entry.kind || record.signature != entry.signature) record.number = number;
        record.name = entry.name;
        record.kind = entry.kind;
        record.signature = entry.signature;
        record.identity = entry.identity;
        fresh.push_back(std::move(record));
    }
    while (old != index.records.end()) depart(*old++);
    index.records = std::move(fresh);
    index.head.sums[0] = disk.sums[0];
    index.head.sums[1] = disk.sums[1];
    index.head.count = disk.entries.size();
    index.head.last = number;
}

// The oldest departures go when they are too many. Their names: collections may have been among them.
std::vector<std::string> forgetDepartures(DirectoryIndex& index) {
    std::vector<int64_t> numbers;
    for (const auto& record : index.records)
        if (record.kind == Kind::gone) numbers.push_back(record.number);
    if (numbers.size() <= TreeJournal::kMostDepartures) return {};
    const auto place = numbers.begin() + static_cast<std::ptrdiff_t>(numbers.size() - TreeJournal::kMostDepartures - 1);
    std::nth_element(numbers.begin(), place, numbers.end());
    const int64_t until = *place;
    std::vector<std::string> names;
    std::erase_if(index.records, [&](const DirectoryIndex::Record& record) {
        const bool goes = record.kind == Kind::gone && record.number <= until;
        if (goes) names.push_back(record.name);
        return goes;
    });
    index.head.since = std::max(index.head.since, until);
    return names;
}

struct Found {
    TreeJournal::Change change;
    int64_t number = 0;
    uint64_t hash = 0;
    auto key() const { return std::tie(number, hash, change.path); }
};

// One look at a collection, under the lock.
class Look {
public:
    Look(const TreeJournal::Question& question, std::string directory, Head& head, bool mayWrite)
        : _q(question), _directory(std::move(directory)), _head(head), _mayWrite(mayWrite), _place(question.below) {
        if (_q.from) {
            _base = _q.from->cut ? _q.from->cut->base : _q.from->number;
            _young = _q.from->cut ? _q.from->cut->time : _q.from->time;
            _start = _q.from->cut && _q.from->cut->isFirst ? 0 : _base;
        }
    }

    bool make() {
        const int directory = open(_q.path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
        std::string notes = _directory + "/d";
        for (const std::string& segment : _q.below) notes += hex(textHash(segment));
        return directory < 0 ? failed(Outcome::unreadable) : visit(directory, "", notes, 0, 0);
    }

    Outcome outcome = Outcome::told;
    int error = 0;
    bool needsToWrite = false, isDamaged = false, forgot = false;
    std::vector<Found> found;
    int64_t last = 0, newest = 0;

private:
    bool failed(Outcome why) {
        outcome = why;
        error = errno;
        return false;
    }

    bool number() {
        if (_number) return true;
        _number = std::max(_q.now / 1000, _head.last + 1);
        _head.last = _number;
        return _head.write() || failed(Outcome::unwritable); // before what has the number
    }

    bool note(DirectoryIndex& index, bool isNew, const DiskState& disk, const std::string& notes) {
        if (!number()) return false;
        update(index, disk, _number);
        if (isNew) index.head.since = _number;
        std::error_code wrong;
        std::filesystem::create_directories(notes, wrong);
        for (const std::string& name : forgetDepartures(index))
            std::filesystem::remove_all(notes + hex(textHash(name)), wrong);
        return index.write(notes + "/index") || failed(Outcome::unwritable);
    }

    // `appeared`: when the collection, or one that it is in, has come. False: nothing more is to be done.
    bool visit(int directory, const std::string& path, const std::string& notes, int64_t appeared, size_t depth) {
        const int kept = dup(directory);
        auto disk = stateOf(directory);
        struct Close {
            int file;
            ~Close() {
                if (file >= 0) close(file);
            }
        } const closing{kept};
        if (!disk || kept < 0 || depth > kDeepest) return failed(Outcome::unreadable);
        newest = std::max(newest, disk->newest);
        DirectoryIndex index;
        auto state = DirectoryIndex::readHead(notes + "/index", index.head);
        const bool isNew = state == DirectoryIndex::State::absent;
        bool isLoaded = false;
        if (isNew || index.head.sums[0] != disk->sums[0] || index.head.sums[1] != disk->sums[1] ||
            index.head.count != disk->entries.size()) {
            if (state == DirectoryIndex::State::damaged) return damaged();
            needsToWrite = true;
            if (!_mayWrite) return false;
            if (!isNew && DirectoryIndex::read(notes + "/index", index) != DirectoryIndex::State::whole)
                return damaged();
            if (!note(index, isNew, *disk, notes)) return false;
            isLoaded = true;
        } else if (state == DirectoryIndex::State::damaged) {
            return damaged();
        }
        last = std::max(last, index.head.last);
        if (_q.from && index.head.since > _base && appeared <= _base) forgot = true;
        const bool needed = _q.wantsChanges && (!_start || std::max(index.head.last, appeared) > _base);
        if (needed && !isLoaded) {
            state = DirectoryIndex::read(notes + "/index", index);
            if (state != DirectoryIndex::State::whole) return damaged();
            isLoaded = true;
        }
        if (_q.wantsChanges) gather(index, needed, *disk, path, appeared);
        return !_q.isDeep || descend(kept, index, needed, *disk, path, notes, appeared, depth);
    }

    bool damaged() {
        isDamaged = true;
        return false;
    }

    void gather(const DirectoryIndex& index, bool isLoaded, const DiskState& disk, const std::string& path,
                int64_t appeared) {
        const auto isYoung = [&](const DiskEntry& entry) { return _young && entry.changed >= _young - _q.settle; };
        auto entry = disk.entries.begin();
        if (!isLoaded) {
            for (; entry != disk.entries.end(); ++entry)
                if (isYoung(*entry)) add(path, entry->name, entry->kind, _base + 1);
            return;
        }
        for (const auto& record : index.records) {
            int64_t number = std::max(record.number, appeared);
            if (record.kind != Kind::gone) {
                while (entry != disk.entries.end() && entry->name < record.name) ++entry;
                if (entry != disk.entries.end() && entry->name == record.name && isYoung(*entry))
                    number = std::max(number, _base + 1);
            } else {
                number = record.number;
            }
            if (record.kind == Kind::gone ? _q.from && number > _base : number > _start)
                add(path, record.name, record.kind, number);
        }
    }

    void add(const std::string& path, const std::string& name, Kind kind, int64_t number) {
        std::string whole = path.empty() ? name : path + "/" + name;
        const uint64_t hash = textHash(whole);
        const auto& from = _q.from;
        if (from && from->cut && std::tie(number, hash) <= std::tie(from->number, from->cut->hash)) return;
        if (!isShown(name)) return;
        found.push_back({{std::move(whole), kind == Kind::gone, kind == Kind::collection}, number, hash});
    }

    bool isShown(const std::string& name) {
        _place.push_back(name);
        const bool shown = _q.shows(_place);
        _place.pop_back();
        return shown;
    }

    bool descend(int directory, const DirectoryIndex& index, bool isLoaded, const DiskState& disk,
                 const std::string& path, const std::string& notes, int64_t appeared, size_t depth) {
        auto record = index.records.begin();
        for (const DiskEntry& entry : disk.entries) {
            if (entry.kind != Kind::collection || !isShown(entry.name)) continue;
            if (entry.isLink) return failed(Outcome::linked);
            int64_t came = appeared;
            if (isLoaded) {
                while (record != index.records.end() && record->name < entry.name) ++record;
                if (record != index.records.end() && record->name == entry.name)
                    came = std::max(came, record->appeared);
            }
            const int inside = openat(directory, entry.name.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW);
            if (inside < 0 && (errno == ENOENT || errno == ENOTDIR)) continue; // the next look sees that it is gone
            if (inside < 0) return failed(Outcome::unreadable);
            _place.push_back(entry.name);
            const bool done = visit(inside, path.empty() ? entry.name : path + "/" + entry.name,
                                    notes + hex(textHash(entry.name)), came, depth + 1);
            _place.pop_back();
            if (!done) return false;
        }
        return true;
    }

    const TreeJournal::Question& _q;
    const std::string _directory;
    Head& _head;
    const bool _mayWrite;
    std::vector<std::string> _place;
    int64_t _start = 0, _base = 0, _young = 0, _number = 0; // members from _start on, departures from _base on
};

bool beginAnew(const std::string& directory, Head& head) {
    std::error_code wrong;
    std::filesystem::remove_all(directory + "/d", wrong);
    if (wrong) errno = wrong.value();
    return !wrong && head.begin();
}

// A number that was not given yet: the notes were set back to an older copy, and will give it once more.
bool isAhead(const SyncToken& token, int64_t last) {
    return !token.cut && token.number > last;
}

bool isOf(const SyncToken& token, const TreeJournal::Question& q, const Head& head) {
    return token.epoch == head.epoch && token.scope == q.scope && (token.isDeep || !q.isDeep) &&
           !isAhead(token, head.last);
}

void fill(TreeJournal::Answer& answer, Look& look, const TreeJournal::Question& q, uint64_t epoch) {
    const auto& from = q.from;
    const bool isCut = look.found.size() > q.limit;
    const auto byKey = [](const Found& a, const Found& b) { return a.key() < b.key(); };
    if (isCut)
        std::nth_element(look.found.begin(), look.found.begin() + static_cast<std::ptrdiff_t>(q.limit),
                         look.found.end(), byKey);
    if (isCut) look.found.resize(q.limit);
    std::sort(look.found.begin(), look.found.end(), byKey);
    SyncToken& token = answer.token;
    token = {q.isDeep, epoch, q.scope, std::max(look.last, !from ? 0 : from->cut ? from->cut->base : from->number),
             0,        {}};
    // While the pages of one answer follow one another, it is the first one's time that counts.
    token.time = from && from->cut ? from->time : look.newest >= q.now - q.settle ? q.now : 0;
    if (isCut && q.wantsChanges) {
        token.number = look.found.back().number;
        const int64_t whole = from ? (from->cut ? from->cut->base : from->number) : look.last;
        const int64_t time = from ? (from->cut ? from->cut->time : from->time) : 0;
        token.cut = SyncToken::Cut{look.found.back().hash, whole, time, from ? from->cut && from->cut->isFirst : true};
    }
    answer.changes.reserve(look.found.size());
    for (Found& each : look.found) answer.changes.push_back(std::move(each.change));
    answer.outcome = Outcome::told;
}

} // namespace

TreeJournal::Answer TreeJournal::changes(const Question& question) const {
    Answer answer;
    // Most looks find nothing to note; the others are made once more, alone.
    for (const bool alone : {false, true}) {
        Head head(_directory, alone);
        if (!head.isOpen() && !alone) continue;
        if (!head.isWhole() && !alone) continue;
        if (!head.isOpen() || (!head.isWhole() && !beginAnew(_directory, head))) {
            answer.outcome = Outcome::unwritable;
            answer.error = errno;
            return answer;
        }
        for (int attempt = 0;; ++attempt) {
            if (question.from && !isOf(*question.from, question, head)) {
                answer.outcome = Outcome::invalidToken;
                return answer;
            }
            Look look(question, _directory, head, alone);
            if (look.make()) {
                if (look.forgot)
                    answer.outcome = Outcome::invalidToken;
                else
                    fill(answer, look, question, head.epoch);
                return answer;
            }
            if (!alone && (look.needsToWrite || look.isDamaged)) break;
            answer.outcome = look.outcome;
            answer.error = look.error;
            if (!look.isDamaged) return answer;
            if (attempt || !beginAnew(_directory, head)) {
                answer.outcome = Outcome::unwritable;
                answer.error = errno;
                return answer;
            }
        }
    }
    return answer;
}

} // namespace rolvane::davacl
