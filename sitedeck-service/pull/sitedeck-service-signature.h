// Request signing: our own MD5 and the signature of an item-list query, the
// MD5 of the query followed by the signing key shared with the content server.
#pragma once

#include <cstddef>
#include <cstdint>

// The signing key, ROT13-scrambled; unscrambled afresh for every signature.
extern const char sds_request_signing_key[];

// MD5 of `length` bytes as the four result words A, B, C, D.
void sds_md5(const void* data, size_t length, uint32_t digest[4]);
// MD5 of a NUL-terminated text as 32 lower-case hex digits; malloc'ed.
char* sds_md5_hex(const char* text);
// Signature of a query: malloc'ed 32 lower-case hex digits, or null.
char* sds_get_request_hash(const char* query);
