#pragma once

#include "Board.h"

namespace rolvane::board {

// Daemons that stay make pass after pass while people edit and a tenth of the requests fails. In the end all is in
// step, nothing waits, and memory, descriptors and files are those of the first quarter. A case is a pass; one process.
void stayAndWork(Work& work);

} // namespace rolvane::board
