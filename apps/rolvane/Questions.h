#pragma once

#include "Context.h"

#include <string>
#include <vector>

namespace rolvane::cli {

// Asks the person at the terminal: on standard error, answers from standard input. Where nobody may be asked, the
// fallback is the answer. Main thread.
class Questions {
public:
    // `mayAsk`: whoever started the command allows it; a terminal is needed besides.
    Questions(Context& context, bool mayAsk);

    bool mayAsk() const { return _mayAsk; }
    // A line without blanks around it; an empty one gives the fallback.
    std::string text(const std::string& question, const std::string& fallback = {});
    bool yes(const std::string& question, bool fallback);
    // The number of the chosen one, from 0.
    size_t choice(const std::string& question, const std::vector<std::string>& offered, size_t fallback);
    std::string secret(const std::string& question); // not shown; at least one character

private:
    std::string answer(const std::string& prompt); // CommandError when the input has ended

    Context& _context;
    bool _mayAsk;
};

} // namespace rolvane::cli
