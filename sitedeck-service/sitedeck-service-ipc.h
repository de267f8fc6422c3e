// The socket protocol between the browser and the service: raw wire items
// (status, integer, fixed block, string, request header) in host byte order,
// with no framing beyond what each command implies. Both ends are here: the
// service uses the readers and writers, a client library the client end
// (sds_ipc_send_command, sds_ipc_simple_response, sds_ipc_read_int,
// sds_ipc_read_blob). The primitives keep no state and never close the socket.
#pragma once

#include <sys/uio.h>

#include <cstddef>

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

// The constant name of an SDS code; "SDS_ERROR_UNKNOWN" for codes without one.
const char* sds_error_string(int code);

// Sends the items of one reply in one system call: the same bytes, back to
// back, that writing them one by one would put on the wire, with one wake-up
// of the peer instead of one per item. Returns 1 when all went out; 0 when
// nothing did, nothing being logged (the caller writes the items one by one
// instead, each failing and logging as it does); -1 when the reply stopped
// part-way, after "[IPC.Write] exception sock:%d [%s]".
[[nodiscard]] int sds_ipc_send_reply(int sock, const struct iovec* items, int count);
