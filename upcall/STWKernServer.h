// The kernel upcall server: when the sandbox needs the containers of a process it asks
// here, and the daemon creates or looks up every container the request names, with full
// privileges, and answers with their paths.
//
// STWKernServerStart() is run once by the daemon's start-up (a server that cannot start
// stops the daemon); from then on the upcall socket is served by the upcall thread
// "com.vorlane.stowlyd.upcall", one upcall at a time, concurrently with requests. The
// container work takes the same locks as a request's.
//
// demux_server() and server_get_process_containers() are the message layer and the one
// routine, kept as the kernel's protocol defines them; the transport (STWKernTransport.h)
// hands them messages built from the socket's packets.
#pragma once

#include "upcall/STWKernMessages.h"

#include <chrono>

// Checks in the upcall socket and starts serving it on the main event loop. False
// (logged) when the socket cannot be had or watched.
bool STWKernServerStart();
// Stops accepting and drops the upcall connections once the upcall being served (if any)
// is answered; false when that takes longer than `timeout`. On the event loop's thread,
// or once the loop has stopped.
bool STWKernServerStop(std::chrono::steady_clock::duration timeout);

// The demultiplexer: `request` is a received message with its trailer
// (STWKernReceivedRequest), `reply` room for STWKernMaxMessageSize bytes (STWKernReply).
// Answers whether the message was handled; the reply is filled when it was, and for the
// subsystem's unused id (an error reply with -303) even though it was not.
bool demux_server(STWKernHeader* request, STWKernHeader* reply);

// The routine: the containers of the process the request buffer describes, as a reply
// buffer in fresh memory (release with STWKernReleaseReplyMemory when `deallocate`).
// 0, or 4 (bad request, unknown persona), 5 (not the kernel, unreadable item), 9 (no
// memory) or the failure code of the reply copy.
STWKernReturn server_get_process_containers(const void* request, uint32_t requestSize, STWAuditToken auditToken,
                                            void** reply, uint32_t* replySize, bool* deallocate);
