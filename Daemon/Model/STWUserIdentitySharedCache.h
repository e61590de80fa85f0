// The process-wide user identity cache that the container cache and every other service
// share.
#pragma once

#include "Daemon/Model/STWUserIdentityCache.h"

class STWUserIdentitySharedCache : public STWUserIdentityCache {
public:
    static std::shared_ptr<STWUserIdentityCache> sharedInstance();
};
