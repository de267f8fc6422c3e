// Whole-file reads with a size cap, for files whose content comes from the
// network or from disk and is handed to a parser in one piece.
#pragma once

#include <cstddef>

// Reads the regular file at `path` into a malloc'ed buffer (NUL-terminated,
// for convenience) and sets `*length`. Null when the file is missing or
// unreadable, larger than `cap` bytes or growing while read (both logged).
char* sds_read_file_bounded(const char* path, long cap, size_t* length);
