#include "Daemon/Model/STWUserIdentitySharedCache.h"

std::shared_ptr<STWUserIdentityCache> STWUserIdentitySharedCache::sharedInstance() {
    static const std::shared_ptr<STWUserIdentityCache> cache = STWUserIdentityCache::create();
    return cache;
}
