// What every fuzz target shares: one scratch root per process (made once,
// named by $SITEDECK_ROOT, removed at exit), quiet logs (unless
// SITEDECK_FUZZ_LOG=1), whole-file writes, and the one item database opened
// in that root. A target never writes to a fixed path: everything it touches
// lives below the root.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

// Sets up the root on first use and returns it; aborts when it cannot.
const std::string& fuzz_root(void);
// `fixed` (one of the SDS_*_PATH names) below the root.
std::string fuzz_path(const char* fixed);
// Replaces the file at `path` with `size` bytes; aborts on failure, since a
// target that cannot place its input would test nothing.
void fuzz_write_file(const std::string& path, const uint8_t* data, size_t size);
// Opens sds_db_handle in the root, with syncing off: the database is scratch
// and a fuzzer must not wait for the disk.
void fuzz_open_database(void);
// Runs `sql` on sds_db_handle; aborts on failure.
void fuzz_exec(const char* sql);
