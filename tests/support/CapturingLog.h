#pragma once

#include "foundation/Log.h"

#include <algorithm>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace rolvane::test {

// Collects every log line of the process while it lives; puts the former sink back at the end. Any thread may log.
class CapturingLog {
public:
    CapturingLog() : _lines(std::make_shared<Lines>()), _former(LogSink::install(_lines)) {}
    ~CapturingLog() { LogSink::install(_former); }
    CapturingLog(const CapturingLog&) = delete;
    CapturingLog& operator=(const CapturingLog&) = delete;

    std::vector<std::string> lines() const {
        std::lock_guard guard(_lines->mutex);
        return _lines->all;
    }
    void clear() {
        std::lock_guard guard(_lines->mutex);
        _lines->all.clear();
    }
    bool has(const std::string& line) const { return count(line) != 0; }
    size_t count(const std::string& line) const {
        auto all = lines();
        return static_cast<size_t>(std::count(all.begin(), all.end(), line));
    }
    bool mentions(const std::string& part) const {
        auto all = lines();
        return std::any_of(all.begin(), all.end(), [&](const auto& l) { return l.find(part) != std::string::npos; });
    }
    std::string text() const { // all lines, for failure messages
        std::string out;
        for (const auto& line : lines()) out += line + "\n";
        return out;
    }

private:
    struct Lines : LogSink {
        void write(std::string_view line) override {
            std::lock_guard guard(mutex);
            all.emplace_back(line);
        }
        mutable std::mutex mutex;
        std::vector<std::string> all;
    };
    std::shared_ptr<Lines> _lines;
    std::shared_ptr<LogSink> _former;
};

// The process's debug level for the life of this object.
class DebugLevel {
public:
    explicit DebugLevel(int level) : _former(debugLevel()) { setDebugLevel(level); }
    ~DebugLevel() { setDebugLevel(_former); }
    DebugLevel(const DebugLevel&) = delete;
    DebugLevel& operator=(const DebugLevel&) = delete;

private:
    int _former;
};

} // namespace rolvane::test
