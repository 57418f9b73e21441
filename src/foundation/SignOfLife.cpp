#include "foundation/SignOfLife.h"

#include <atomic>

namespace rolvane {

namespace {

// Never given back: signs may come until the process has ended.
std::atomic<const std::function<void()>*> theListener = nullptr;

thread_local bool isSilent = false;

} // namespace

WithoutSignsOfLife::WithoutSignsOfLife() : _before(isSilent) {
    isSilent = true;
}

WithoutSignsOfLife::~WithoutSignsOfLife() {
    isSilent = _before;
}

void signOfLife() {
    if (isSilent) return;
    if (const auto* listener = theListener.load(std::memory_order_acquire)) (*listener)();
}

void setSignOfLifeListener(std::function<void()> listener) {
    theListener.store(new std::function<void()>(std::move(listener)), std::memory_order_release);
}

} // namespace rolvane
