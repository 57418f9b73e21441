#include "contacts/database/OneTurn.h"

#include "contacts/database/RolvaneImpl.h"

namespace rolvane {

OneTurn::OneTurn(CXRolvane& rolvane) : _lock(rolvane.impl().mutex), _moment(rolvane) {}

} // namespace rolvane
