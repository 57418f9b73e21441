#pragma once

#include <functional>

namespace rolvane {

// Work that takes long calls this wherever it has got on by a step: an answer of the store, an applied record. Any
// thread; nothing happens until a listener is set.
void signOfLife();

// While it lives, its thread gives no signs: a thread beside the work must not speak for work that is stuck.
class WithoutSignsOfLife {
public:
    WithoutSignsOfLife();
    ~WithoutSignsOfLife();
    WithoutSignsOfLife(const WithoutSignsOfLife&) = delete;
    WithoutSignsOfLife& operator=(const WithoutSignsOfLife&) = delete;

private:
    const bool _before;
};

// Sets the one listener of the process, before there are threads that call `signOfLife`. It may be called on any
// thread.
void setSignOfLifeListener(std::function<void()> listener);

} // namespace rolvane
