#pragma once

#include "foundation/Notification.h"

#include <cstdint>
#include <string>
#include <string_view>

namespace rolvane {

// One message on the daemon's control socket:
//
//   frame   = length body        length: four bytes, the most significant first, at most kMostBytes
//   body    = a BinaryValue of { "kind": "post" | "ask" | "observe" | "heard", ... }
//   post    = "name", "userInfo", and "object" when there is one; "number" when an answer is wanted
//   ask     = "number": whether somebody is there
//   observe = "names": array of strings, all that the sender wants to hear of from now on
//   heard   = "number" of what is answered; "observed": whether anybody acts on what was posted
struct ControlMessage {
    static constexpr size_t kMostBytes = size_t{1} << 20;

    enum class Kind { post, ask, observe, heard };
    Kind kind = Kind::ask;
    int64_t number = 0; // 0: nobody waits for an answer
    Notification notification;
    std::vector<std::string> names;
    bool observed = false;

    // The whole frame. CXException for what is larger than a frame may be.
    std::string frame() const;
};

// Takes frames apart as their bytes come. Bytes that are no frame throw CXException; the connection is to be given up.
class ControlReader {
public:
    void append(std::string_view bytes) { _bytes.append(bytes); }
    std::optional<ControlMessage> next(); // none while the next frame is not whole

private:
    std::string _bytes;
};

} // namespace rolvane
