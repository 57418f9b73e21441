#include "SurvivingDisk.h"

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <optional>

namespace rolvane::board {

namespace {

namespace fs = std::filesystem;
constexpr size_t kSector = 512;

std::optional<std::string> contentOf(const std::string& path) {
    std::error_code none;
    if (!fs::is_regular_file(path, none)) return std::nullopt;
    std::ifstream file(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(file), {});
}

} // namespace

SurvivingDisk::FileRef& SurvivingDisk::at(const std::string& path) {
    if (!_now.contains(path)) {
        FileRef file;
        if (const auto content = contentOf(_before + path.substr(_root.size()))) {
            file = std::make_shared<File>();
            file->safe = *content;
        }
        _now[path] = _safe[path] = file;
    }
    return _now[path];
}

void SurvivingDisk::apply(const Change& change, std::string& content) {
    const auto offset = static_cast<size_t>(change.offset);
    if (change.what == RecordedChange::truncate) return content.resize(offset);
    if (content.size() < offset + change.bytes.size()) content.resize(offset + change.bytes.size());
    content.replace(offset, change.bytes.size(), change.bytes);
}

void SurvivingDisk::apply(const NameChange& change, Names& names) {
    if (change.what == RecordedChange::rename) names[change.other] = change.file;
    names[change.path] = change.what == RecordedChange::create ? change.file : nullptr;
}

void SurvivingDisk::syncDirectory(const std::string& directory) {
    // A journal keeps the order: what came before is safe, too.
    const auto isHere = [&](const NameChange& change) { return fs::path(change.path).parent_path() == directory; };
    const auto last = std::find_if(_later.rbegin(), _later.rend(), isHere).base();
    std::for_each(_later.begin(), last, [&](const NameChange& change) { apply(change, _safe); });
    _later.erase(_later.begin(), last);
}

void SurvivingDisk::take(const RecordedChange& change, const std::string& path, const std::string& other,
                         std::string bytes) {
    const auto what = static_cast<RecordedChange::What>(change.what);
    if (what == RecordedChange::syncDirectory) return syncDirectory(path);
    if (what == RecordedChange::makeDirectory) return;
    FileRef& file = at(path);
    switch (what) {
    case RecordedChange::create: file = std::make_shared<File>(); break;
    case RecordedChange::rename: {
        const FileRef moved = file;
        at(other) = moved;
        _now[path] = nullptr;
        _later.push_back({what, path, other, moved});
        return;
    }
    case RecordedChange::write:
    case RecordedChange::truncate:
        if (file) file->later.push_back({what, change.offset, std::move(bytes)});
        return;
    case RecordedChange::sync:
        if (file)
            for (const Change& each : file->later) apply(each, file->safe);
        if (file) file->later.clear();
        return;
    default: file = nullptr; break;
    }
    _later.push_back({what, path, other, file});
}

void SurvivingDisk::read(const std::string& record) {
    const std::string all = contentOf(record).value_or("");
    for (size_t at = 0; at + sizeof(RecordedChange) <= all.size();) {
        RecordedChange change{};
        std::memcpy(&change, all.data() + at, sizeof change);
        at += sizeof change;
        const auto next = [&](int64_t size) {
            const std::string part = all.substr(at, static_cast<size_t>(size));
            at += static_cast<size_t>(size);
            return part;
        };
        const std::string path = next(change.pathLength), other = next(change.otherLength);
        take(change, path, other, next(change.size));
    }
}

void SurvivingDisk::write(Survives what, worlds::Chance& chance) const {
    Names names = _safe;
    const size_t reached = what == Survives::nothing      ? 0
                           : what == Survives::everything ? _later.size()
                                                          : chance.below(_later.size() + 1);
    for (size_t i = 0; i < reached; ++i) apply(_later[i], names);
    for (const auto& [path, file] : names) {
        std::error_code none;
        fs::remove(path, none);
        if (!file || path.ends_with("-shm")) continue; // that one holds nothing that a process needs
        std::string content = file->safe;
        for (const Change& each : file->later) {
            if (what == Survives::nothing || (what == Survives::some && chance.happens(0.5))) continue;
            Change part = each;
            if (what == Survives::some && chance.happens(0.2))
                part.bytes.resize(std::min(part.bytes.size(), kSector * chance.below(1 + part.bytes.size() / kSector)));
            apply(part, content);
        }
        std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
        fs::permissions(path, fs::perms::owner_read | fs::perms::owner_write, none);
    }
}

} // namespace rolvane::board
