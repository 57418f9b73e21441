#include "server/mod_davacl/NewsRing.h"

#include <algorithm>
#include <climits>
#include <cstring>
#include <ctime>
#include <linux/futex.h>
#include <memory>
#include <new>
#include <openssl/evp.h>
#include <openssl/rand.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace rolvane::davacl {
namespace {

constexpr char kDigits[] = "0123456789abcdef";

int digitOf(char c) {
    const char* found = c ? std::strchr(kDigits, c) : nullptr;
    return found ? static_cast<int>(found - kDigits) : -1;
}

} // namespace

NewsRing* NewsRing::map() {
    void* memory = mmap(nullptr, sizeof(NewsRing), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    if (memory == MAP_FAILED) return nullptr;
    auto* made = new (memory) NewsRing;
    if (RAND_priv_bytes(made->_key.data(), static_cast<int>(made->_key.size())) == 1 &&
        RAND_bytes(reinterpret_cast<unsigned char*>(&made->_epoch), sizeof made->_epoch) == 1)
        return made;
    munmap(memory, sizeof(NewsRing));
    return nullptr;
}

uint64_t NewsRing::numberOf(std::string_view name) {
    std::array<unsigned char, EVP_MAX_MD_SIZE> digest{};
    uint64_t number = 0;
    if (EVP_Digest(name.data(), name.size(), digest.data(), nullptr, EVP_sha256(), nullptr))
        std::memcpy(&number, digest.data(), sizeof number);
    return number ? number : 1;
}

void NewsRing::post(const Note& note) {
    const uint64_t position = _next.fetch_add(1, std::memory_order_acq_rel);
    Slot& slot = _slots[position % kSlots];
    slot.number.store(0, std::memory_order_release);
    slot.tree.store(note.tree, std::memory_order_release);
    slot.writer.store(note.writer, std::memory_order_release);
    slot.number.store(position + 1, std::memory_order_release);
    ring();
}

NewsRing::Notes NewsRing::from(uint64_t position) const {
    Notes found;
    const uint64_t end = this->position();
    if (position > end || end - position > kSlots) return {false, {}, end};
    found.notes.reserve(end - position);
    for (found.next = position; found.next < end; ++found.next) {
        const Slot& slot = _slots[found.next % kSlots];
        const uint64_t number = slot.number.load(std::memory_order_acquire);
        if (number > found.next + 1) return {false, {}, end};
        if (number < found.next + 1) break; // its writer is at it
        const Note note{slot.tree.load(std::memory_order_acquire), slot.writer.load(std::memory_order_acquire)};
        if (slot.number.load(std::memory_order_acquire) != number) return {false, {}, end};
        found.notes.push_back(note);
    }
    return found;
}

// The word lies in memory of several processes, so the private form of the call would not do.
void NewsRing::waitForBell(uint32_t seen, int milliseconds) const {
    timespec limit{milliseconds / 1000, static_cast<long>(milliseconds % 1000) * 1000000};
    syscall(SYS_futex, &_bell, FUTEX_WAIT, seen, &limit, nullptr, 0);
}

void NewsRing::ring() {
    _bell.fetch_add(1, std::memory_order_acq_rel);
    syscall(SYS_futex, &_bell, FUTEX_WAKE, INT_MAX, nullptr, nullptr, 0);
}

std::optional<NewsRing::Block> NewsRing::ciphered(const Block& block, bool encrypts) const {
    const std::unique_ptr<EVP_CIPHER_CTX, decltype(&EVP_CIPHER_CTX_free)> context(EVP_CIPHER_CTX_new(),
                                                                                  EVP_CIPHER_CTX_free);
    Block out{};
    int length = 0;
    const bool made =
        context && EVP_CipherInit_ex(context.get(), EVP_aes_128_ecb(), nullptr, _key.data(), nullptr, encrypts) &&
        EVP_CIPHER_CTX_set_padding(context.get(), 0) &&
        EVP_CipherUpdate(context.get(), out.data(), &length, block.data(), static_cast<int>(block.size()));
    return made && length == static_cast<int>(out.size()) ? std::optional(out) : std::nullopt;
}

std::string NewsRing::token(uint64_t position) const {
    Block block{};
    std::memcpy(block.data(), &_epoch, sizeof _epoch);
    std::memcpy(block.data() + sizeof _epoch, &position, sizeof position);
    const auto hidden = ciphered(block, true);
    std::string text;
    if (hidden)
        for (const unsigned char byte : *hidden) text += {kDigits[byte >> 4], kDigits[byte & 15]};
    return text;
}

std::optional<uint64_t> NewsRing::positionOf(std::string_view token) const {
    Block block{};
    if (token.size() != 2 * block.size()) return std::nullopt;
    for (size_t i = 0; i < block.size(); ++i) {
        const int high = digitOf(token[2 * i]), low = digitOf(token[2 * i + 1]);
        if (high < 0 || low < 0) return std::nullopt;
        block[i] = static_cast<unsigned char>(high * 16 + low);
    }
    const auto shown = ciphered(block, false);
    uint64_t epoch = 0, position = 0;
    if (!shown) return std::nullopt;
    std::memcpy(&epoch, shown->data(), sizeof epoch);
    std::memcpy(&position, shown->data() + sizeof epoch, sizeof position);
    return epoch == _epoch ? std::optional(position) : std::nullopt;
}

} // namespace rolvane::davacl
