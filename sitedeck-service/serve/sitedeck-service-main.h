// The connection acceptor and the client worker: accept the one connection of
// this process, hand out a client id, create the shared-memory object, start
// the worker and send the handshake; the worker then serves requests one at a
// time until the connection ends, and quits the main loop.
#pragma once

#include <cstdint>

#include "sitedeck-service-types.h"

typedef struct _GMainLoop GMainLoop;

// Set once by main before the acceptor runs; the worker quits it when done.
extern GMainLoop* sds_main_loop;

// Accepts one client and starts its worker; 0 when the handshake went out.
int sds_main_thread(sds_server_context* context);
// Worker thread entry; `slot` is the address of the context's client slot.
void* sds_client_thread_idle(void* slot);
// Reads one request header and dispatches it; returns an SDS code.
int __sds_handle_client_request(sds_client* slot);
// Returns a new client id, always greater than 0 and never the previous one.
int sds_generate_client_id(void);
// The id for a time of day (seconds, microseconds), in wrapping 32-bit
// arithmetic; results of 0 or below are folded into the positive range.
int32_t sds_client_id_from_time(int32_t seconds, int32_t microseconds);
