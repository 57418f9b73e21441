#pragma once

namespace rolvane {

// Seconds since the machine was started, time asleep included (CLOCK_BOOTTIME). The same clock for every process of
// the machine; nobody can set it. Any thread.
double secondsSinceBoot();

} // namespace rolvane
