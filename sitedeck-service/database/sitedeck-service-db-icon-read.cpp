// Icons in the item table, the serving half: an item's pixel rows with the
// width and height its icon_size text gives, for command 7, and the reading
// of that size text, which the storing half (sitedeck-service-db-icon.cpp)
// shares. Command 7 copies the pixels once, from the file's pages straight
// into the shared memory: a copy on the heap first, and SQLite's gathering
// of the pages into one value before that, cost more than the copy itself.
#include <climits>
#include <cstring>

#include "database/sitedeck-service-db-interface.h"
#include "database/sitedeck-service-db-stmt.h"
#include "database/sitedeck-service-error.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-raii.h"

namespace {

constexpr const char* kSiteDeck = "site_deck";

// The leading decimal number of `text` as atoi reads it (blanks, a sign,
// digits), saturated instead of overflowing; 0 when there are no digits.
int leading_int(const char* text) {
  while (*text == ' ' || (*text >= '\t' && *text <= '\r')) ++text;
  bool negative = *text == '-';
  if (*text == '+' || *text == '-') ++text;
  long long value = 0;
  for (; *text >= '0' && *text <= '9'; ++text) {
    value = value * 10 + (*text - '0');
    if (value > INT_MAX) value = INT_MAX + 1LL;
  }
  if (negative) value = -value;
  if (value > INT_MAX) return INT_MAX;
  if (value < INT_MIN) return INT_MIN;
  return static_cast<int>(value);
}

}  // namespace

bool sds_db_parse_icon_size(const char* text, int* width, int* height) {
  const char* x = std::strchr(text, 'x');
  if (x == nullptr) return false;
  *width = leading_int(text);
  *height = leading_int(x + 1);
  return true;
}

namespace {

// Checks the outputs of an icon read in the order the messages name them.
int check_icon_outputs(const void* value, const int* length, const int* width, const int* height) {
  if (value == nullptr) {
    SDS_LOGE("NULL check::value");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (length == nullptr) {
    SDS_LOGE("NULL check::blob_length");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (width == nullptr) {
    SDS_LOGE("NULL check::blob_width");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  if (height == nullptr) {
    SDS_LOGE("NULL check::blob_height");
    return SDS_ERROR_INVALID_PARAMETER;
  }
  return SDS_ERROR_NONE;
}

// Reads the item's icon size text into width and height (left alone when the
// text has no x); the code of the read.
int read_icon_dimensions(int id, int* width, int* height) {
  int code = SDS_ERROR_NONE;
  char* size_text = nullptr;
  (void)sds_db_get_property_string(sds_db_handle, id, kSiteDeck, "icon_size", &size_text, &code);
  UniqueCStr size_owner(size_text);
  if (code != SDS_ERROR_NONE) {
    SDS_LOGE("Error : %s", sds_error_string(code));
    return code;
  }
  (void)sds_db_parse_icon_size(size_text, width, height);
  return SDS_ERROR_NONE;
}

}  // namespace

int sds_copy_blob_from_db(int id, int* length, int* height, int* width,
                          unsigned char* (*place)(int length, void* user), void* user) {
  if (int checked = check_icon_outputs(place == nullptr ? nullptr : &place, length, width, height);
      checked != SDS_ERROR_NONE) {
    return checked;
  }
  int code = SDS_ERROR_NONE;
  SqliteKeptStmt transaction;
  (void)sds_db_check_property_blob(sds_db_handle, id, kSiteDeck, "icon_data", &transaction, length,
                                   &code);
  if (code != SDS_ERROR_NONE) {
    SDS_LOGE("Error : %s", sds_error_string(code));
    return code;
  }
  code = read_icon_dimensions(id, width, height);
  if (code != SDS_ERROR_NONE) return code;
  unsigned char* destination = place(*length, user);
  if (destination != nullptr &&
      sds_db_read_property_blob(sds_db_handle, id, kSiteDeck, "icon_data", destination, *length,
                                &code) != 0) {
    SDS_LOGE("Error : %s", sds_error_string(code));
    return code;
  }
  return SDS_ERROR_NONE;
}

int sds_get_blob_from_db(int id, int* length, int* height, int* width, unsigned char** bytes) {
  if (int checked = check_icon_outputs(bytes, length, width, height);
      checked != SDS_ERROR_NONE) {
    return checked;
  }
  int code = SDS_ERROR_NONE;
  (void)sds_db_get_property_blob(sds_db_handle, id, kSiteDeck, "icon_data", bytes, length, &code);
  if (code != SDS_ERROR_NONE) {
    SDS_LOGE("Error : %s", sds_error_string(code));
    return code;
  }
  code = read_icon_dimensions(id, width, height);
  if (code != SDS_ERROR_NONE) return code;
  return SDS_ERROR_NONE;
}
