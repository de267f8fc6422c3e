// Linear pre-check of JSON text: nesting depth and the cost of repeated member
// names. Member names are decoded the way json-glib decodes them (escapes,
// surrogate pairs, cut at an embedded NUL) so that differently spelled repeats
// of one name are counted as repeats.
#include "pull/sitedeck-service-json-guard.h"

#include <cstdint>
#include <new>
#include <string>
#include <unordered_set>
#include <vector>

namespace {

struct Frame {
  bool object = false;
  bool want_key = false;
  std::unordered_set<std::string> names;
};

int __hex_value(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// Reads four hex digits at `p`; -1 when they are not there.
long __read_unit(const char* p, const char* end) {
  if (end - p < 4) return -1;
  long unit = 0;
  for (int i = 0; i < 4; ++i) {
    int digit = __hex_value(p[i]);
    if (digit < 0) return -1;
    unit = unit * 16 + digit;
  }
  return unit;
}

void __append_utf8(std::string* out, uint32_t cp) {
  if (cp < 0x80) {
    out->push_back(static_cast<char>(cp));
  } else if (cp < 0x800) {
    out->push_back(static_cast<char>(0xC0 | (cp >> 6)));
    out->push_back(static_cast<char>(0x80 | (cp & 0x3F)));
  } else if (cp < 0x10000) {
    out->push_back(static_cast<char>(0xE0 | (cp >> 12)));
    out->push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | (cp & 0x3F)));
  } else {
    out->push_back(static_cast<char>(0xF0 | (cp >> 18)));
    out->push_back(static_cast<char>(0x80 | ((cp >> 12) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | (cp & 0x3F)));
  }
}

// Scans the string whose opening quote was at p[-1]; returns the position
// after the closing quote, or null when the text ends first. When `decoded`
// is given, the string's decoded bytes go there.
const char* __scan_string(const char* p, const char* end, std::string* decoded) {
  while (p < end) {
    char c = *p++;
    if (c == '"') return p;
    if (c != '\\') {
      if (decoded != nullptr) decoded->push_back(c);
      continue;
    }
    if (p == end) return nullptr;
    char e = *p++;
    if (decoded == nullptr) continue;
    switch (e) {
      case 'b':
        decoded->push_back('\b');
        break;
      case 'f':
        decoded->push_back('\f');
        break;
      case 'n':
        decoded->push_back('\n');
        break;
      case 'r':
        decoded->push_back('\r');
        break;
      case 't':
        decoded->push_back('\t');
        break;
      case 'u': {
        long unit = __read_unit(p, end);
        if (unit < 0) break;
        p += 4;
        uint32_t cp = static_cast<uint32_t>(unit);
        if (cp >= 0xD800 && cp <= 0xDBFF && end - p >= 6 && p[0] == '\\' && p[1] == 'u') {
          long low = __read_unit(p + 2, end);
          if (low >= 0xDC00 && low <= 0xDFFF) {
            cp = 0x10000 + ((cp - 0xD800) << 10) + (static_cast<uint32_t>(low) - 0xDC00);
            p += 6;
          }
        }
        __append_utf8(decoded, cp);
        break;
      }
      default:
        decoded->push_back(e);
        break;
    }
  }
  return nullptr;
}

int __check(const char* data, size_t length, const char** reason) {
  std::vector<Frame> frames;
  long repeat_cost = 0;
  std::string key;
  const char* p = data;
  const char* end = data + length;
  while (p < end) {
    char c = *p++;
    switch (c) {
      case '[':
      case '{':
        if (frames.size() >= static_cast<size_t>(SDS_JSON_MAX_DEPTH)) {
          *reason = "nesting too deep";
          return -1;
        }
        frames.emplace_back();
        frames.back().object = (c == '{');
        frames.back().want_key = (c == '{');
        break;
      case ']':
      case '}':
        if (!frames.empty()) frames.pop_back();
        break;
      case ',':
        if (!frames.empty() && frames.back().object) frames.back().want_key = true;
        break;
      case '"': {
        bool is_key = !frames.empty() && frames.back().want_key;
        key.clear();
        p = __scan_string(p, end, is_key ? &key : nullptr);
        if (p == nullptr) return 0;  // unterminated: json-glib refuses it
        if (!is_key) break;
        Frame& frame = frames.back();
        frame.want_key = false;
        size_t nul = key.find('\0');
        if (nul != std::string::npos) key.resize(nul);
        if (!frame.names.insert(key).second) {
          repeat_cost += static_cast<long>(frame.names.size());
          if (repeat_cost > SDS_JSON_MAX_REPEAT_COST) {
            *reason = "too many repeated member names";
            return -1;
          }
        }
        break;
      }
      default:
        break;
    }
  }
  return 0;
}

}  // namespace

int sds_json_guard_check(const char* data, size_t length, const char** reason) {
  const char* ignored = nullptr;
  if (reason == nullptr) reason = &ignored;
  if (data == nullptr) {
    *reason = "no data";
    return -1;
  }
  try {
    return __check(data, length, reason);
  } catch (const std::bad_alloc&) {
    *reason = "out of memory";
    return -1;
  }
}
