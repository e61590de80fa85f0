// Turns each request into one call of a command handler: finds the command's row,
// describes the caller, decides what it is entitled to, builds the request's client
// connection, runs the handler and the commands it queued, and answers with
// "ReplyError".
#pragma once

#include "Daemon/Lifecycle/STWCommandQueue.h"
#include "Daemon/Request/STWClientConnection.h"
#include "Daemon/Request/STWCommandTable.h"
#include "common/STWValue.h"

#include <memory>

class STWPeerConnection;

class STWRequestDispatcher {
public:
    // Handles one request of `peer` on the calling thread and answers it (or leaves the
    // answer to the handler's completion).
    static void processTolvanEvent(const std::shared_ptr<STWPeerConnection>& peer, uint64_t requestID,
                                   const STWValue::Dictionary& request);

    // The entitlement decision for `entry` and `clientIdentity` (which may be absent):
    // the request's client connection, or nullptr when the caller gets none.
    static std::shared_ptr<STWClientConnection>
    checkEntitlementsAndInitClientObject(const STWCommandTableEntry& entry, const STWClientIdentityRef& clientIdentity,
                                         const std::shared_ptr<STWCommandQueue>& commandQueue);

    // The dispatch part of processTolvanEvent without the peer: runs `request` for
    // `clientIdentity`, fills `reply` and answers whether the dispatcher must send it.
    static bool dispatch(const STWValue::Dictionary& request, const STWReplyRef& reply,
                         const STWClientIdentityRef& clientIdentity, uint64_t* error);
};
