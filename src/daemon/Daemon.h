#pragma once

namespace rolvane {

// The daemon from its first line to its last: reads the debug level and the arguments, checks in with the service
// launcher, runs one pass when anything is shared or subscribed, arms the idle exit and serves the run loop. "-p" makes
// it end as soon as it is idle; every other argument is ignored. Returns 0 in every path that returns; an exception of
// any class but CXException passes on. A second daemon of the same user says so and returns.
int runDaemon(int argc, char** argv);

} // namespace rolvane
