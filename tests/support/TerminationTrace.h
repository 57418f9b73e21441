#pragma once

namespace rolvane::test {

// From the first call on, a test program that std::terminate ends says on standard error from where.
void traceTermination();

} // namespace rolvane::test
