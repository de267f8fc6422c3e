// Steps the command calls share: reading the rest of a reply exactly, and
// giving up on a connection whose byte stream has gone out of step.
#pragma once

#include <cstddef>
#include <cstdint>

#include "sitedeck-client.h"

// Closes the connection when `status` means the service is ending it (an
// I/O failure on either side, or its allocation failing); returns `status`.
int __sds_client_status_ends(SdsConnection& connection, int status);

// Reads exactly `length` bytes of a reply. A reply that breaks off or times
// out leaves unknown bytes in the stream: the connection is closed and
// SDS_ERROR_IO_ERROR returned.
int __sds_client_read_exact(SdsConnection& connection, void* buffer, size_t length);

// Sends `length` bytes in one write; on failure closes the connection and
// returns SDS_ERROR_IO_ERROR.
int __sds_client_send(SdsConnection& connection, const void* buffer, size_t length);
