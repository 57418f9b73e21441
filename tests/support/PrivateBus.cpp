#include "support/PrivateBus.h"

#include <csignal>
#include <fstream>
#include <stdexcept>

#include <unistd.h>

namespace rolvane::test {

namespace {

std::string configuration(const std::string& socket) {
    return "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\"\n"
           " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
           "<busconfig><type>session</type><listen>unix:path=" +
           socket +
           "</listen><auth>EXTERNAL</auth>"
           "<policy context=\"default\"><allow send_destination=\"*\" eavesdrop=\"true\"/>"
           "<allow eavesdrop=\"true\"/><allow own=\"*\"/></policy></busconfig>\n";
}

} // namespace

PrivateBus::PrivateBus() : _address("unix:path=" + (_directory / "bus")) {
    std::ofstream(_directory / "bus.conf") << configuration(_directory / "bus");
    restart();
}

void PrivateBus::kill() {
    _daemon.reset();
}

void PrivateBus::restart() {
    kill();
    ::unlink((_directory / "bus").c_str());
    _daemon = std::make_unique<ChildProcess>(std::vector<std::string>{
        "dbus-daemon", "--config-file=" + (_directory / "bus.conf"), "--nofork", "--nopidfile", "--print-address=1"});
    if (!_daemon->waitForLine("^unix:", 30))
        throw std::runtime_error("the private bus did not start: " + _daemon->errors());
}

void PrivateBus::pause() {
    _daemon->signal(SIGSTOP);
}
void PrivateBus::resume() {
    _daemon->signal(SIGCONT);
}

} // namespace rolvane::test
