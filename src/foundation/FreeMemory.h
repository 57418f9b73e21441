#pragma once

namespace rolvane {

// How the process keeps the memory that it has freed. A first publication frees more than a hundred megabytes, and the
// daemon then lives on for days.

// To be called before the process has other threads: they share few heaps, so that what one has freed serves the
// others.
void shareHeaps();
// Gives what is free back to the system. Takes milliseconds where much has been freed. Any thread.
void returnFreeMemory();

} // namespace rolvane
