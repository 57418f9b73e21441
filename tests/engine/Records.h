#pragma once

#include "foundation/Log.h"
#include "model/CXDChangeRecord.h"

#include <memory>
#include <mutex>
#include <rapidcheck.h>
#include <string>
#include <vector>

namespace rolvane::test {

struct RecordShape {
    int32_t initial = CXDSyncSourceCX;
    int32_t appliesTo = CXDSyncSourceVaultra;
    const char* user = "<self>";
};

inline CXDChangeRecordPtr makeRecord(int32_t type, const char* person, const char* group, RecordShape shape = {},
                                     Value payload = {}) {
    const auto strong = [](const char* text) { return text ? std::optional(UniqueId(text)) : std::nullopt; };
    auto record = std::make_shared<CXDChangeRecord>(shape.initial, type,
                                                    shape.user ? std::optional(UserName(shape.user)) : std::nullopt,
                                                    strong(person), strong(group), std::move(payload));
    record->setAppliesToSources(shape.appliesTo);
    return record;
}

// Few identifiers, users and types, so that records meet often.
inline rc::Gen<CXDChangeRecordPtr> arbitraryRecord() {
    return rc::gen::exec([] {
        static const std::vector<const char*> persons = {nullptr, "P1", "P2", "G1"};
        static const std::vector<const char*> groups = {nullptr, "G1", "G2", "P1", "People", "AllCXGroup"};
        static const std::vector<const char*> users = {"<self>", "ann", "bob"};
        const int32_t type =
            *rc::gen::elementOf(std::vector<int32_t>{1, 2, 3, 4, 5, 6, 7, 8, 9, 257, 258, 259, 260, 261});
        RecordShape shape;
        shape.initial = *rc::gen::elementOf(std::vector<int32_t>{1, 4});
        shape.appliesTo = *rc::gen::elementOf(std::vector<int32_t>{1, 4, 5, 2, 6, 8, 31});
        shape.user = *rc::gen::elementOf(users);
        Value payload;
        const int form = *rc::gen::inRange(0, 4);
        if (form == 1) payload = "name";
        if (form == 2) payload = Dictionary{{"GroupName", "name"}, {"memberAdds", Array{"P1"}}};
        return makeRecord(type, *rc::gen::elementOf(persons), *rc::gen::elementOf(groups), shape, payload);
    });
}

inline std::vector<const CXDChangeRecord*> identities(const CXDChangeRecords& records) {
    std::vector<const CXDChangeRecord*> all;
    for (const CXDChangeRecordPtr& record : records) all.push_back(record.get());
    return all;
}

// Collects the log while it lives, at the given debug level.
class LogCapture {
public:
    explicit LogCapture(int level = 1) : _before(debugLevel()), _sink(std::make_shared<Sink>()) {
        setDebugLevel(level);
        _former = LogSink::install(_sink);
    }
    ~LogCapture() {
        LogSink::install(_former);
        setDebugLevel(_before);
    }
    std::vector<std::string> lines() const {
        const std::lock_guard guard(_sink->lock);
        return _sink->lines;
    }
    bool has(const std::string& part) const {
        for (const std::string& line : lines())
            if (line.find(part) != std::string::npos) return true;
        return false;
    }

private:
    struct Sink : LogSink {
        mutable std::mutex lock;
        std::vector<std::string> lines;
        void write(std::string_view line) override {
            const std::lock_guard guard(lock);
            lines.emplace_back(line);
        }
    };
    int _before;
    std::shared_ptr<Sink> _sink;
    std::shared_ptr<LogSink> _former;
};

} // namespace rolvane::test
