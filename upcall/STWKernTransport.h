// How the upcall messages travel over the upcall socket, one packet per message.
//
// A request packet is the 56-byte request layout followed by the request buffer. The
// transport delivers it to the server as the kernel would: the out-of-line descriptor
// names the bytes behind the layout (its address and size are those of what arrived,
// whatever the sender wrote there, so a data count that disagrees is a type error), and
// the receiver's trailer carries the sequence number, the sender's euid and egid, and its
// audit token, whose pid is 0 for a root sender: on this platform root stands for the
// kernel. A packet shorter than the layout arrives with that size and is refused by the
// size check.
//
// A reply packet is the 36-byte error reply, or the 56-byte success reply (its address
// field 0) followed by the reply buffer.
//
// A packet shorter than a message header, or one no routine handles and that got no
// reply (an id outside the subsystem), closes the connection: the sender learns at once
// that nothing will answer.
#pragma once

#include "platform/STWAuditToken.h"

#include <cstdint>
#include <string>
#include <string_view>

// The reply packet for `packet` from a peer with `peerToken`, the connection's
// `sequence`-th; false when the connection is to be closed instead.
bool STWKernServePacket(std::string_view packet, const STWAuditToken& peerToken, uint32_t sequence,
                        std::string* reply);
