#include "server/mod_davacl/SignInMemory.h"

#include <cstring>
#include <new>
#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/rand.h>
#include <string>
#include <sys/mman.h>

namespace rolvane::davacl {
namespace {

// The lengths keep two fields from passing for others.
void append(std::string& text, std::string_view field) {
    const uint64_t length = field.size();
    text.append(reinterpret_cast<const char*>(&length), sizeof length);
    text.append(field);
}

} // namespace

SignInMemory* SignInMemory::map() {
    void* memory = mmap(nullptr, sizeof(SignInMemory), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    if (memory == MAP_FAILED) return nullptr;
    auto* made = new (memory) SignInMemory;
    if (RAND_priv_bytes(made->_key.data(), static_cast<int>(made->_key.size())) == 1) return made;
    munmap(memory, sizeof(SignInMemory));
    return nullptr;
}

void SignInMemory::unmap() {
    munmap(this, sizeof(SignInMemory));
}

SignInMemory::Mark SignInMemory::markOf(std::string_view user, std::string_view line, std::string_view password) const {
    std::string text;
    text.reserve(user.size() + line.size() + password.size() + 3 * sizeof(uint64_t));
    for (const std::string_view field : {user, line, password}) append(text, field);
    std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
    unsigned int length = 0;
    Mark mark{};
    const bool made = HMAC(EVP_sha256(), _key.data(), static_cast<int>(_key.size()),
                           reinterpret_cast<const unsigned char*>(text.data()), text.size(), digest.data(), &length);
    OPENSSL_cleanse(text.data(), text.size());
    if (made && length == sizeof mark) std::memcpy(mark.data(), digest.data(), sizeof mark);
    return mark;
}

bool SignInMemory::holds(const Slot& slot, const Mark& mark) {
    uint64_t difference = 0;
    for (size_t i = 0; i < mark.size(); ++i) difference |= slot[i].load(std::memory_order_relaxed) ^ mark[i];
    return difference == 0;
}

bool SignInMemory::knows(const Mark& mark) const {
    if (mark == Mark{}) return false; // an empty slot, and a mark that could not be made
    bool known = false;
    for (const Slot& slot : _sets[mark[0] % kSets]) known |= holds(slot, mark);
    return known;
}

// While another process reads, a slot may hold a part of two marks. That is no third one which anybody could have.
void SignInMemory::remember(const Mark& mark) {
    if (mark == Mark{} || knows(mark)) return;
    const size_t set = mark[0] % kSets;
    Slot& slot = _sets[set][_next[set].fetch_add(1, std::memory_order_relaxed) % kWays];
    for (size_t i = 0; i < mark.size(); ++i) slot[i].store(mark[i], std::memory_order_relaxed);
}

} // namespace rolvane::davacl
