// The socket protocol between the browser and the service: raw wire items
// (status, integer, fixed block, string, request header) in host byte order,
// with no framing beyond what each command implies. Both ends are here: the
// service uses the readers and writers, a client library the client end
// (sds_ipc_send_command, sds_ipc_simple_response, sds_ipc_read_int,
// sds_ipc_read_blob). The primitives never close the socket; the only state
// they keep is the bound the service puts on the request it is serving.
#pragma once

#include <sys/uio.h>

#include <cstddef>

#include "database/sitedeck-service-error.h"
#include "sitedeck-service-types.h"

// One read of up to `length` bytes, retried at most three times on EAGAIN or
// EINTR. Returns the last read's count, 0 for a closed peer, -1 on error.
// A short read is not completed.
int sds_ipc_recv(int sock, void* buffer, size_t length, const char* tag);

// Logs the current errno and maps it to an SDS code, `default_code` for
// anything but EPIPE, EAGAIN and EINTR.
int sds_ipc_check_stderr(int default_code);

// Reads a 32-bit status (or flag); returns 1 when nothing could be read.
int sds_ipc_read_errorcode(int sock);
[[nodiscard]] int sds_ipc_send_errorcode(int sock, int code);
[[nodiscard]] int sds_ipc_send_command(int sock, const sds_command* command);
// Client end: one read of 4 bytes; returns the value (also stored) or -1.
int sds_ipc_read_int(int sock, int* value);
[[nodiscard]] int sds_ipc_read_custom_type(int sock, void* buffer, size_t length);
// Returns a malloc'ed NUL-terminated copy of the string item, or null.
char* sds_ipc_read_string(int sock);
[[nodiscard]] int sds_ipc_send_string(int sock, const char* text);
// Client end: sends the header and reads the status; returns an SDS code.
int sds_ipc_simple_response(int sock, const sds_command* command);
[[nodiscard]] int sds_ipc_send_custom_type(int sock, const void* buffer, size_t length);
// Client end: reads exactly `size` bytes in chunks of at most 1024.
[[nodiscard]] int sds_ipc_read_blob(int sock, void* buffer, size_t size);

// Sends the items of one reply in one system call: the same bytes, back to
// back, that writing them one by one would put on the wire, with one wake-up
// of the peer instead of one per item. Returns 0 when all went out, -1 after
// "[IPC.Write] exception sock:%d [%s]" otherwise.
[[nodiscard]] int sds_ipc_send_reply(int sock, const struct iovec* items, int count);

// Service end: bounds the request whose header has just been read on `sock`,
// until sds_ipc_request_end. The reads of its remaining items on this thread
// wait no longer than `timeout_ms` from this call, all together: a request
// whose bytes stop arriving half-way does not hold the connection for ever.
// After the first write that failed, or read that timed out, every further
// write of `sock` fails at once and logs nothing, so that a broken reply is
// neither continued nor logged item by item; after a time-out, reads do the
// same. The client end never calls this; unbounded, the primitives block as
// they always did.
void sds_ipc_request_begin(int sock, int timeout_ms);
// Ends the bound. Returns 0 when the request's reads and writes went
// through, else the errno of the first failure (ETIMEDOUT: the request did
// not arrive in time); the connection has to end then.
int sds_ipc_request_end(int sock);
