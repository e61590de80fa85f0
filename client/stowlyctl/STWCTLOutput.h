// How stowlyctl prints replies: readable lines, or one JSON object for scripts.
#pragma once

#include "common/STWValue.h"

#include <string>

// "ReplyError: 55 (NotEntitled)" first, then "Key: description" for every other key.
std::string STWCTLReplyText(const STWValue::Dictionary& reply);

// One JSON object on one line. UUIDs and dates are strings (dates in RFC 3339, UTC), data
// is base64; a real that JSON cannot represent (nan, inf) is null.
std::string STWCTLReplyJSON(const STWValue::Dictionary& reply);
std::string STWCTLJSONValue(const STWValue& value);

std::string STWCTLBase64(const STWData& data);

// "55 NotEntitled: not entitled": the number, the name and the meaning of a result code.
std::string STWCTLErrorCodeText(uint64_t code);
