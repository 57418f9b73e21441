#pragma once

namespace rolvane::cli {

// An entry that switches the address books on when their user logs in on a desktop (`rolvane books on`), where no
// systemd of the user's keeps their port: $XDG_CONFIG_HOME/autostart/rolvane-books.desktop. CXException on failure.
void setBooksAutostart(bool wanted);

} // namespace rolvane::cli
