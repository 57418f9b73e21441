#include "store/http/WriterName.h"

#include <algorithm>
#include <array>
#include <iterator>
#include <random>

namespace rolvane {

const std::string& writerName() {
    static const std::string name = [] {
        std::random_device device;
        std::string text;
        for (int i = 0; i < 16; ++i) text += "0123456789abcdef"[device() % 16];
        return text;
    }();
    return name;
}

bool namesItsWriter(std::string_view method) {
    constexpr std::array<std::string_view, 9> kChanging = {"PUT",  "DELETE", "MKCOL",     "MOVE",  "COPY",
                                                           "LOCK", "ACL",    "PROPPATCH", "REPORT"};
    return std::find(kChanging.begin(), kChanging.end(), method) != kChanging.end();
}

} // namespace rolvane
