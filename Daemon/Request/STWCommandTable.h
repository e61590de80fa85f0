// The fixed table of the daemon's 32 commands: for each, its handler, the entitlement a
// caller must hold, and how the dispatcher treats it. Dispatch is an index into this
// table.
#pragma once

#include "Daemon/Request/STWReply.h"
#include "common/STWValue.h"

#include <array>
#include <cstdint>

class STWClientConnection;

// Reads its keys from `request`, calls the connection's operations, writes its reply
// keys and, on failure, stores a code in `error` (which the caller set to 1).
using STWCommandHandler = void (*)(const STWValue::Dictionary& request, const STWReplyRef& reply,
                                   STWClientConnection& connection, uint64_t* error);

struct STWCommandTableEntry {
    uint64_t command;
    STWCommandHandler handler;
    const char* requiredEntitlement;
    // 1: the dispatcher sends the reply; 0: the handler's completion does.
    uint8_t sendsReply;
    // 1: a connection is made even for a caller who is not entitled; the handler applies
    // its own narrower rules.
    uint8_t allowsUnentitled;
    // 1: for a caller without the allowed entitlement, its lookup entitlement is read.
    uint8_t acceptsLookupEntitlement;
    uint8_t spare;
};

inline constexpr uint64_t STWCommandCount = 32;
extern const std::array<STWCommandTableEntry, STWCommandCount> STWCommandTable;

inline constexpr const char* STWEntitlementAllowed = "com.vorlane.private.Stowly.allowed";
inline constexpr const char* STWEntitlementOtherIdLookup = "com.vorlane.private.Stowly.otherIdLookup";
inline constexpr const char* STWEntitlementLookup = "com.vorlane.private.Stowly.lookup";
inline constexpr const char* STWEntitlementWipeContainer = "com.vorlane.private.Stowly.wipeContainer";
inline constexpr const char* STWEntitlementTestability = "com.vorlane.private.Stowly.testability";
inline constexpr const char* STWEntitlementUserManagedAssets = "com.vorlane.private.Stowly.userManagedAssets";
inline constexpr const char* STWEntitlementDeleteContainerContent = "com.vorlane.private.Stowly.deleteContainerContent";
inline constexpr const char* STWEntitlementDataMigration = "com.vorlane.private.Stowly.dataMigration";
inline constexpr const char* STWEntitlementStageSharedContent = "com.vorlane.private.Stowly.stageSharedContent";
