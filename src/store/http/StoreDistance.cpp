#include "store/http/StoreDistance.h"

#include "store/dav/CXDAVManagerImpl.h"

namespace rolvane {

bool isStoreFar(const CXDAVManager& manager) {
    return manager.impl()->session.isFar();
}

} // namespace rolvane
