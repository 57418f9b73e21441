#pragma once

#include <string>
#include <vector>

namespace rolvane {

// What every method answers to everybody at every kind of place in a shared tree: the data of the tests, from which
// docs/access-matrix.md is written.
struct AccessRow {
    const char* method;
    const char* place; // a name of kAccessPlaces
    int owner, writer, reader, member, stranger, anonymous;
};
struct AccessPlace {
    const char* name;
    const char* path; // as it is sent; for COPY and MOVE of "own", the Destination
    const char* description;
};

extern const std::vector<AccessPlace> kAccessPlaces;
extern const std::vector<AccessRow> kAccessMatrix;
std::string accessMatrixDocument();

} // namespace rolvane
