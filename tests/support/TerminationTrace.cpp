#include "support/TerminationTrace.h"

#include <array>
#include <exception>
#include <execinfo.h>
#include <unistd.h>

namespace rolvane::test {

void traceTermination() {
    static const std::terminate_handler former = std::set_terminate([] {
        std::array<void*, 64> frames;
        const int count = ::backtrace(frames.data(), static_cast<int>(frames.size()));
        ::backtrace_symbols_fd(frames.data(), count, STDERR_FILENO);
        former();
    });
    (void)former;
}

} // namespace rolvane::test
