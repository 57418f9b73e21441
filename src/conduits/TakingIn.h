#pragma once

namespace rolvane {

class ConduitEngine;
class CXRolvane;
class Preferences;

// A computer that joins others, or has lost its memory of a tree that it shares with them, first takes the whole tree
// in: nothing of its own is sent before. The note of it stands in the contact database's conduit data, so that a reset
// takes it away, too:
//
//   "takingIn" -> {"<self>" -> "reads" while passes take the tree in, "scan" until the next scan has taken everything}
inline constexpr const char* kTakingIn = "takingIn";

// Is the next pass one that only takes in? It is where the tree is published from several computers, and this one does
// not know it.
bool isTakingIn(ConduitEngine& engine, const Preferences& preferences, CXRolvane& database);
void beginTakingIn(ConduitEngine& engine, CXRolvane& database); // forgets all that is remembered of the own tree
void endTakingIn(ConduitEngine& engine);                        // it has been taken in
void forgetTakingIn(ConduitEngine& engine);
// True once behind that: the scan takes whatever did not come from the tree, however old it is.
bool scansAfterTakingIn(ConduitEngine& engine);

// In the prior state of the owner's tree, until it has been compared: every contact is read.
inline constexpr const char* kAllIsNew = "AllIsNew";

} // namespace rolvane
