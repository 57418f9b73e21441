#include "server/mod_davacl/SignInBrake.h"

#include <algorithm>
#include <new>
#include <sys/mman.h>
#include <sys/random.h>

namespace rolvane::davacl {

SignInBrake* SignInBrake::map() {
    void* memory = mmap(nullptr, sizeof(SignInBrake), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    if (memory == MAP_FAILED) return nullptr;
    auto* brake = new (memory) SignInBrake;
    const auto size = static_cast<ssize_t>(sizeof brake->_key);
    if (getrandom(brake->_key.data(), sizeof brake->_key, 0) == size) return brake;
    brake->unmap();
    return nullptr;
}

void SignInBrake::unmap() {
    munmap(this, sizeof(SignInBrake));
}

// FNV-1a. Who makes two places one slows himself down with it.
uint64_t SignInBrake::place(std::string_view user, std::string_view address) {
    constexpr size_t kNetwork = 8, kIPv4 = 4;
    if (address.size() > kIPv4) address = address.substr(0, kNetwork);
    uint64_t number = 14695981039346656037U;
    const auto add = [&](std::string_view text) {
        for (const char c : text) number = (number ^ static_cast<unsigned char>(c)) * 1099511628211U;
    };
    add(user);
    add(std::string_view("\0", 1));
    add(address);
    return number ? number : 1;
}

// The place's slot, or one that becomes it. Two who take one at the same moment may both write to it: then one guess is
// not counted.
SignInBrake::Slot& SignInBrake::slotOf(uint64_t place, int64_t now) {
    uint64_t mixed = (place ^ _key[0]) * 0x9e3779b97f4a7c15U;
    mixed ^= mixed >> 32;
    mixed = (mixed ^ _key[1]) * 0xd6e8feb86659fd93U;
    auto& set = _sets[(mixed >> 32) % kSets];
    const auto found = std::find_if(set.begin(), set.end(), [&](const Slot& slot) { return slot.place == place; });
    if (found != set.end()) return *found;
    Slot& oldest =
        *std::min_element(set.begin(), set.end(), [](const Slot& a, const Slot& b) { return a.last < b.last; });
    oldest.place = place;
    oldest.wrong = oldest.looking = 0;
    oldest.until = oldest.looked = 0;
    oldest.last = now;
    return oldest;
}

bool SignInBrake::looks(uint64_t place, int64_t now) {
    Slot& slot = slotOf(place, now);
    if (now < slot.until) return false;
    if (now - slot.looked >= kLongestLook) slot.looking = 0;
    const uint32_t others = slot.looking.fetch_add(1);
    if (others > 0 && slot.wrong + others >= kFreeTries) {
        --slot.looking;
        return false;
    }
    slot.looked = now;
    return true;
}

int64_t SignInBrake::wrong(uint64_t place, int64_t now) {
    Slot& slot = slotOf(place, now);
    if (now - slot.last >= kForgotten) slot.wrong = 0;
    slot.last = now;
    const uint32_t count = ++slot.wrong;
    int64_t pause = count < kFreeTries ? 0 : kFirstPause;
    for (uint32_t i = kFreeTries; i < count && pause < kLongestPause; ++i) pause *= 2;
    pause = std::min(pause, kLongestPause);
    slot.until = now + pause;
    if (slot.looking > 0) --slot.looking;
    return pause;
}

void SignInBrake::right(uint64_t place) {
    Slot& slot = slotOf(place, 0);
    slot.wrong = slot.looking = 0;
    slot.until = 0;
}

} // namespace rolvane::davacl
