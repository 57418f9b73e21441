#pragma once

#include "server/mod_cardbook/BookMemory.h"

#include <set>

namespace rolvane::cardbook {

// The cards that each device is known to have and the properties that it understands, in the books' memory. A device is
// who is signed in. One thread at a time; each writing operation is durable on return.
class Devices {
public:
    explicit Devices(BookMemory& memory) : _sqlite(memory.sqlite()) {}

    // The device was sent all cards that a book held at that number and moment. To be told of their tags is not to have
    // them: the answer with the cards may never arrive.
    void noteLook(const std::string& device, const std::string& book, int64_t sequence, Date when);
    // The device was sent these cards, each of that state.
    void noteHad(const std::string& device, const std::vector<std::pair<UniqueId, Date>>& cards);
    // The device was told of everything that had left the book until that number.
    void noteListed(const std::string& device, const std::string& book, int64_t sequence);
    // The device was told that this card has left, or has taken it out itself.
    void noteTold(const std::string& device, const std::string& book, const Member& departed);
    // Has the device had the card, which somebody else has taken out of the book without its knowing?
    bool isUnawareOf(const std::string& device, const std::string& book, const Member& departed);
    void noteKnowledge(const std::string& device, const std::set<std::string>& properties);
    // False where the device would understand more properties than any program does.
    bool mayLearn(const std::string& device, const std::set<std::string>& properties);
    static constexpr int64_t kMostKnown = 5000; // of a device

    bool knows(const std::string& device, const std::string& property);

    // The state of a card that the device had last.
    struct Had {
        bool isPresent = false;   // the present one
        std::optional<Date> then; // one of that moment; nothing: not known
    };
    Had had(const std::string& device, const std::string& book, const Member& now);
    int64_t lookedAt(const std::string& device, const std::string& book); // the number of the latest look, else -1
    bool isCoveredByLook(const std::string& device, const std::string& book, const Member& member) {
        return lookedAt(device, book) >= member.sequence;
    }

private:
    int64_t toldOf(const std::string& device, const std::string& book, std::string_view uid); // else -1
    std::vector<std::string> unknown(const std::string& device, const std::set<std::string>& properties);

    Sqlite& _sqlite;
};

} // namespace rolvane::cardbook
