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

int64_t Devices::toldOf(const std::string& device, const std::string& book, std::string_view uid) {
    auto s = _sqlite.statement("SELECT seq FROM told WHERE device=?1 AND book=?2 AND uid=?3");
    return s.bind(1, device).bind(2, book).bind(3, uid).step() ? s.integer(0) : -1;
}

// Nothing is written where nothing has left since.
void Devices::noteListed(const std::string& device, const std::string& book, int64_t sequence) {
    const int64_t known = toldOf(device, book, "");
    if (known >= sequence) return;
    if (known >= 0) {
        auto left =
            _sqlite.statement("SELECT 1 FROM members INDEXED BY members_gone WHERE gone AND seq>?1 AND seq<=?2 AND "
                              "book=(SELECT id FROM books WHERE book=?3) LIMIT 1");
        if (!left.bind(1, known).bind(2, sequence).bind(3, book).step()) return;
    }
    auto s = _sqlite.statement("INSERT OR REPLACE INTO told VALUES(?,?,'',?)");
    s.bind(1, device).bind(2, book).bind(3, sequence).run();
}

void Devices::noteTold(const std::string& device, const std::string& book, const Member& departed) {
    if (toldOf(device, book, "") >= departed.sequence || toldOf(device, book, departed.uid.str()) >= departed.sequence)
        return;
    auto s = _sqlite.statement("INSERT OR REPLACE INTO told VALUES(?,?,?,?)");
    s.bind(1, device).bind(2, book).bind(3, departed.uid.str()).bind(4, departed.sequence).run();
}

// A device that never looked into the book has had none of its cards.
bool Devices::isUnawareOf(const std::string& device, const std::string& book, const Member& departed) {
    const int64_t looked = lookedAt(device, book), listed = toldOf(device, book, "");
    if (looked < 0 && listed < 0) return false;
    if (listed >= departed.sequence || toldOf(device, book, departed.uid.str()) >= departed.sequence) return false;
    auto s = _sqlite.statement("SELECT 1 FROM had WHERE device=?1 AND uid=?2");
    return looked >= 0 || s.bind(1, device).bind(2, departed.uid.str()).step();
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
