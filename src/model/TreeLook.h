#pragma once

namespace rolvane {

// How a look at one tree of a store has ended.
enum class TreeLook {
    read,      // whole
    notRead,   // not reached, or only a part of it
    leftAlone, // it is not what it was, so that it says nothing
    ended      // there is nothing any more, or nothing for this user
};

} // namespace rolvane
