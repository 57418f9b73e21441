#pragma once

#include <string>

namespace rolvane {

// Notices to the person at the desktop. Exists so that the conduits need no desktop and tests none.
class UserAlert {
public:
    // The alert levels of the platform that the system uses.
    static constexpr int kPlainLevel = 3;

    struct Text {
        std::string header, message, defaultButton; // localized
        std::string icon;                           // an icon's name in the desktop's theme
        int level = kPlainLevel;
    };

    virtual ~UserAlert() = default;
    // Shows the alert and waits, without a time-out of its own, for the answer, which nobody asks for. Where no alert
    // can be shown it returns at once. On the caller's thread; throws nothing.
    virtual void show(const Text& text) = 0;
    // Shows a notice and returns at once.
    virtual void tell(const Text& text) = 0;
};

} // namespace rolvane
