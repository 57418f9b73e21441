#pragma once

#include <chrono>

namespace rolvane {

// Ports of the loopback addresses. A store listens on 127.0.0.1 and, where the machine has it, on ::1.
class LoopbackPort {
public:
    static bool hasIPv6();
    static bool isFree(int port); // on every loopback address
    // A free one below the range from which the kernel takes the ports of outgoing connections, so that none of those
    // can sit on it while the store is stopped. CXException when none was found.
    static int choose();
    // Whether whoever listens there answers: a request in clear, or the opening of a TLS connection.
    static bool answers(int port, bool tls, std::chrono::seconds timeout);
};

} // namespace rolvane
