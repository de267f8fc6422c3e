// Request signing: MD5 as RFC 1321 defines it, and the signature of an
// item-list query, the MD5 of the query followed by the key shared with the
// content server. The key is built into the binary only in ROT13-scrambled
// form (scrambled by the compiler, so the plain key is never in the object
// file), unscrambled into a fresh buffer for each signature and wiped after.
// Nothing here logs the key or the joined text.
#include "pull/sitedeck-service-signature.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>

#include "sitedeck-service-raii.h"

namespace {

constexpr char __rot13(char c) {
  if (c >= 'a' && c <= 'z') return static_cast<char>('a' + (c - 'a' + 13) % 26);
  if (c >= 'A' && c <= 'Z') return static_cast<char>('A' + (c - 'A' + 13) % 26);
  return c;
}

constexpr size_t kKeyLength = 32;

struct ScrambledKey {
  char text[kKeyLength + 1];
};

// Runs in the compiler only: the plain literal is never emitted.
consteval ScrambledKey __scramble(const char (&plain)[kKeyLength + 1]) {
  ScrambledKey out{};
  for (size_t i = 0; i < kKeyLength; ++i) out.text[i] = __rot13(plain[i]);
  out.text[kKeyLength] = '\0';
  return out;
}

static_assert(sizeof(SITEDECK_SIGNING_KEY) == kKeyLength + 1, "the signing key has 32 characters");
constexpr ScrambledKey kScrambledKey = __scramble(SITEDECK_SIGNING_KEY);

}  // namespace

#define SDS_KEY_CHAR(i) kScrambledKey.text[i]
#define SDS_KEY_CHARS4(i) \
  SDS_KEY_CHAR(i), SDS_KEY_CHAR(i + 1), SDS_KEY_CHAR(i + 2), SDS_KEY_CHAR(i + 3)
const char sds_request_signing_key[kKeyLength + 1] = {
    SDS_KEY_CHARS4(0),  SDS_KEY_CHARS4(4),  SDS_KEY_CHARS4(8),
    SDS_KEY_CHARS4(12), SDS_KEY_CHARS4(16), SDS_KEY_CHARS4(20),
    SDS_KEY_CHARS4(24), SDS_KEY_CHARS4(28), '\0'};
#undef SDS_KEY_CHARS4
#undef SDS_KEY_CHAR

namespace {

uint32_t g_sine_table[64];
std::once_flag g_sine_once;

// Entry i is the integer part of |sin(i + 1)| * 2^32, as RFC 1321 defines it.
void __fill_sine_table() {
  for (int i = 0; i < 64; ++i) {
    g_sine_table[i] = static_cast<uint32_t>(std::fabs(std::sin(i + 1.0)) * 4294967296.0);
  }
}

constexpr int kShift[64] = {7, 12, 17, 22, 7, 12, 17, 22, 7, 12, 17, 22, 7, 12, 17, 22,
                            5, 9,  14, 20, 5, 9,  14, 20, 5, 9,  14, 20, 5, 9,  14, 20,
                            4, 11, 16, 23, 4, 11, 16, 23, 4, 11, 16, 23, 4, 11, 16, 23,
                            6, 10, 15, 21, 6, 10, 15, 21, 6, 10, 15, 21, 6, 10, 15, 21};

uint32_t __rotl(uint32_t x, int n) { return (x << n) | (x >> (32 - n)); }

void __md5_block(uint32_t state[4], const unsigned char block[64]) {
  uint32_t m[16];
  for (int i = 0; i < 16; ++i) {
    m[i] = static_cast<uint32_t>(block[i * 4]) | static_cast<uint32_t>(block[i * 4 + 1]) << 8 |
           static_cast<uint32_t>(block[i * 4 + 2]) << 16 |
           static_cast<uint32_t>(block[i * 4 + 3]) << 24;
  }
  uint32_t a = state[0], b = state[1], c = state[2], d = state[3];
  for (int i = 0; i < 64; ++i) {
    uint32_t f;
    int g;
    if (i < 16) {
      f = (b & c) | (~b & d);
      g = i;
    } else if (i < 32) {
      f = (d & b) | (~d & c);
      g = (5 * i + 1) % 16;
    } else if (i < 48) {
      f = b ^ c ^ d;
      g = (3 * i + 5) % 16;
    } else {
      f = c ^ (b | ~d);
      g = (7 * i) % 16;
    }
    uint32_t rotated = __rotl(a + f + g_sine_table[i] + m[g], kShift[i]);
    a = d;
    d = c;
    c = b;
    b = b + rotated;
  }
  state[0] += a;
  state[1] += b;
  state[2] += c;
  state[3] += d;
}

}  // namespace

void sds_md5(const void* data, size_t length, uint32_t digest[4]) {
  std::call_once(g_sine_once, __fill_sine_table);
  uint32_t state[4] = {0x67452301, 0xefcdab89, 0x98badcfe, 0x10325476};
  const auto* bytes = static_cast<const unsigned char*>(data);
  size_t whole = length - length % 64;
  for (size_t offset = 0; offset < whole; offset += 64) __md5_block(state, bytes + offset);

  // The tail, the 0x80 byte, zeros and the bit length fill one or two blocks.
  unsigned char tail[128] = {};
  size_t rest = length - whole;
  if (rest > 0) std::memcpy(tail, bytes + whole, rest);
  tail[rest] = 0x80;
  size_t tail_length = rest + 1 + 8 <= 64 ? 64 : 128;
  uint64_t bits = static_cast<uint64_t>(length) * 8;
  for (int i = 0; i < 8; ++i)
    tail[tail_length - 8 + i] = static_cast<unsigned char>(bits >> (8 * i));
  for (size_t offset = 0; offset < tail_length; offset += 64) __md5_block(state, tail + offset);

  for (int i = 0; i < 4; ++i) digest[i] = state[i];
}

char* sds_md5_hex(const char* text) {
  if (text == nullptr) return nullptr;
  uint32_t digest[4];
  sds_md5(text, std::strlen(text), digest);
  auto* hex = static_cast<char*>(std::malloc(33));
  if (hex == nullptr) return nullptr;
  for (int w = 0; w < 4; ++w) {
    for (int b = 0; b < 4; ++b) {
      std::snprintf(hex + w * 8 + b * 2, 3, "%02x", (digest[w] >> (8 * b)) & 0xffu);
    }
  }
  return hex;
}

char* sds_get_request_hash(const char* query) {
  if (query == nullptr) return nullptr;
  UniqueCStr key(static_cast<char*>(std::malloc(kKeyLength + 1)));
  if (!key) return nullptr;
  // Read through a pointer the optimiser cannot see through: with the
  // array's value known, it would otherwise unscramble the key while
  // compiling and emit the plain key as a constant.
  const char* volatile scrambled = sds_request_signing_key;
  const char* source = scrambled;
  for (size_t i = 0; i <= kKeyLength; ++i) key.get()[i] = __rot13(source[i]);

  size_t query_length = std::strlen(query);
  UniqueCStr joined(static_cast<char*>(std::malloc(query_length + kKeyLength + 1)));
  char* hash = nullptr;
  if (joined) {
    std::snprintf(joined.get(), query_length + kKeyLength + 1, "%s%s", query, key.get());
    hash = sds_md5_hex(joined.get());
    explicit_bzero(joined.get(), query_length + kKeyLength + 1);
  }
  explicit_bzero(key.get(), kKeyLength + 1);
  return hash;
}
