#include "Daemon/Model/STWUserIdentitySharedCache.h"

std::shared_ptr<STWUserIdentityCache> STWUserIdentitySharedCache::sharedInstance() {
    static const std::shared_ptr<STWUserIdentityCache> cache = [] {
        std::shared_ptr<STWUserIdentitySharedCache> shared(new STWUserIdentitySharedCache);
        shared->_registerForPersonaListUpdates();
        return shared;
    }();
    return cache;
}
