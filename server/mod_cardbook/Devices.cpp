#include "server/mod_cardbook/Devices.h"

namespace rolvane::cardbook {

void Devices::noteLook(const std::string& device, const std::string& book, int64_t sequence, Date when) {
    if (lookedAt(device, book) >= sequence) return;
    auto s = _sqlite.statement("INSERT OR REPLACE INTO looks VALUES(?,?,?,?)");
    s.bind(1, device).bind(2, book).bind(3, sequence).bind(4, when.secondsSince1970()).run();
}

void Devices::noteHad(const std::string& device, const std::vector<std::pair<UniqueId, Date>>& cards) {
    std::vector<const std::pair<UniqueId, Date>*> news;
    for (const auto& card : cards) {
        auto s = _sqlite.statement("SELECT 1 FROM had WHERE device=?1 AND uid=?2 AND date=?3");
        if (!s.bind(1, device).bind(2, card.first.str()).bind(3, card.second.secondsSince1970()).step())
            news.push_back(&card);
    }
    if (news.empty()) return;
    SqliteTransaction transaction(_sqlite);
    for (const auto* card : news) {
        auto s = _sqlite.statement("INSERT OR REPLACE INTO had VALUES(?,?,?)");
        s.bind(1, device).bind(2, card->first.str()).bind(3, card->second.secondsSince1970()).run();
    }
    transaction.commit();
}

void Devices::noteKnowledge(const std::string& device, const std::set<std::string>& properties) {
    const std::vector<std::string> fresh = unknown(device, properties);
    if (fresh.empty()) return;
    SqliteTransaction transaction(_sqlite);
    for (const std::string& property : fresh)
        _sqlite.statement("INSERT OR IGNORE INTO knows VALUES(?,?)").bind(1, device).bind(2, property).run();
    transaction.commit();
}

bool Devices::mayLearn(const std::string& device, const std::set<std::string>& properties) {
    const auto fresh = static_cast<int64_t>(unknown(device, properties).size());
    auto count = _sqlite.statement("SELECT count(*) FROM knows WHERE device=?");
    return fresh == 0 || (count.bind(1, device).step() && count.integer(0) + fresh <= kMostKnown);
}

std::vector<std::string> Devices::unknown(const std::string& device, const std::set<std::string>& properties) {
    std::vector<std::string> all;
    for (const std::string& property : properties)
        if (!knows(device, property)) all.push_back(property);
    return all;
}

bool Devices::knows(const std::string& device, const std::string& property) {
    auto s = _sqlite.statement("SELECT 1 FROM knows WHERE device=?1 AND property=?2");
    return s.bind(1, device).bind(2, property).step();
}

int64_t Devices::lookedAt(const std::string& device, const std::string& book) {
    auto s = _sqlite.statement("SELECT seq FROM looks WHERE device=?1 AND book=?2");
    return s.bind(1, device).bind(2, book).step() ? s.integer(0) : -1;
}

Devices::Had Devices::had(const std::string& device, const std::string& book, const Member& now) {
    Had known;
    {
        auto s = _sqlite.statement("SELECT seq, date FROM looks WHERE device=?1 AND book=?2");
        if (s.bind(1, device).bind(2, book).step()) {
            if (s.integer(0) >= now.sequence) known.isPresent = true;
            known.then = Date(s.real(1));
        }
    }
    auto s = _sqlite.statement("SELECT date FROM had WHERE device=?1 AND uid=?2");
    if (s.bind(1, device).bind(2, now.uid.str()).step()) {
        const Date had(s.real(0));
        if (had == now.modified) known.isPresent = true;
        if (!known.then || *known.then < had) known.then = had;
    }
    return known;
}

} // namespace rolvane::cardbook
