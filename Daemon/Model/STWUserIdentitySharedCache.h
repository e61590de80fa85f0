// The process-wide user identity cache that the container cache and every other service
// share.
#pragma once

#include "Daemon/Model/STWUserIdentityCache.h"

class STWUserIdentitySharedCache : public STWUserIdentityCache {
public:
    // Created, and registered for persona-list updates, on first use.
    static std::shared_ptr<STWUserIdentityCache> sharedInstance();

protected:
    const char* _className() const override { return "STWUserIdentitySharedCache"; }

private:
    STWUserIdentitySharedCache() = default;
};
