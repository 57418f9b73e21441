#include "server/mod_davacl/SignInBrake.h"

#include <algorithm>
#include <new>
#include <sys/mman.h>

namespace rolvane::davacl {

SignInBrake* SignInBrake::map() {
    void* memory = mmap(nullptr, sizeof(SignInBrake), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    return memory == MAP_FAILED ? nullptr : new (memory) SignInBrake;
}

void SignInBrake::unmap() {
    munmap(this, sizeof(SignInBrake));
}

// FNV-1a; who makes two places collide gains a slot that both share, and slows himself down with it.
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

bool SignInBrake::looks(uint64_t place, int64_t now) const {
    const Slot& slot = _slots[place % _slots.size()];
    return slot.place.load() != place || now >= slot.until.load();
}

int64_t SignInBrake::wrong(uint64_t place, int64_t now) {
    Slot& slot = _slots[place % _slots.size()];
    if (slot.place.exchange(place) != place || now - slot.last.load() >= kForgotten) slot.wrong = 0;
    slot.last = now;
    const uint32_t count = ++slot.wrong;
    int64_t pause = count < kFreeTries ? 0 : kFirstPause;
    for (uint32_t i = kFreeTries; i < count && pause < kLongestPause; ++i) pause *= 2;
    pause = std::min(pause, kLongestPause);
    slot.until = now + pause;
    return pause;
}

void SignInBrake::right(uint64_t place) {
    Slot& slot = _slots[place % _slots.size()];
    if (slot.place.load() != place) return;
    slot.wrong = 0;
    slot.until = 0;
}

} // namespace rolvane::davacl
