// Icon files and pixel conversion: the local file of an icon URL, PNG to raw
// B,G,R,A rows and back (libpng, in memory), and file removal with a log line.
#pragma once

#include <cstddef>

// Returns the malloc'ed path of the icon file for `icon_url`, or null. The
// name is unique per URL and keeps the URL's last path segment readable.
char* get_icon_path(const char* icon_url);
// Decodes a PNG held in memory into rows of 4-byte B,G,R,A pixels (malloc'ed,
// owned by the caller). Returns 0, or -1 leaving every output untouched.
int convert_png_to_raw_data(const unsigned char* png, size_t png_length, unsigned char** raw_data,
                            int* width, int* height, int* size);
// Why the last convert_png_to_raw_data on this thread failed: "not a PNG",
// libpng's message, or the size refusal. Constant until the next call.
const char* sds_png_failure(void);
// Empties the images directory, which holds icons only while a pull stores
// them: files a pull killed in the middle left there. Returns how many went.
int sds_images_sweep(void);
// Encodes B,G,R,A rows into a malloc'ed PNG. Returns 0, or -1.
int convert_raw_data_to_png(const unsigned char* raw_data, int width, int height,
                            unsigned char** png, int* png_size);
// Unlinks `path`; 0 on success, -1 with a log line otherwise.
int remove_file(const char* path);
