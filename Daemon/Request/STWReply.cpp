#include "Daemon/Request/STWReply.h"

#include "common/STWIPCFrame.h"
#include "platform/STWPeerConnection.h"

bool STWReply::sendWithError(uint64_t error) {
    _body["ReplyError"] = STWValue(error);
    return _peer && _peer->sendFrame(STWFrameKindReply, _requestID, _body);
}
