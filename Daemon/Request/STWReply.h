// The reply to one request: its message dictionary and the connection and request id it
// goes back on. Handlers fill the dictionary; the dispatcher sends it, or, for commands
// that answer from a completion, the completion does.
#pragma once

#include "common/STWValue.h"

#include <cstdint>
#include <memory>

class STWPeerConnection;

class STWReply {
public:
    STWReply(std::shared_ptr<STWPeerConnection> peer, uint64_t requestID)
        : _peer(std::move(peer)), _requestID(requestID) {}

    STWValue::Dictionary& body() { return _body; }
    const STWValue::Dictionary& body() const { return _body; }
    void set(std::string key, STWValue value) { _body[std::move(key)] = std::move(value); }
    uint64_t requestID() const { return _requestID; }

    // Sets "ReplyError" and sends the reply; false when the peer is gone.
    bool sendWithError(uint64_t error);

private:
    std::shared_ptr<STWPeerConnection> _peer;
    uint64_t _requestID;
    STWValue::Dictionary _body;
};
using STWReplyRef = std::shared_ptr<STWReply>;
