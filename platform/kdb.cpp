// File-backed key store of the platform stand-ins.
#include "kdb.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {

constexpr const char* kKdbDir = "/opt/var/kdb/";
// Configuration values are short texts; anything bigger is not a value.
constexpr long kMaxValueBytes = 64 * 1024;

std::string key_path(const char* key) {
  const char* root = std::getenv("SITEDECK_ROOT");
  std::string path = (root != nullptr && root[0] != '\0') ? root : "";
  path += kKdbDir;
  path += key;
  return path;
}

bool valid_key(const char* key) {
  return key != nullptr && key[0] != '\0' && key[0] != '/' && std::strstr(key, "..") == nullptr;
}

void make_parents(const std::string& path) {
  for (size_t slash = path.find('/', 1); slash != std::string::npos;
       slash = path.find('/', slash + 1)) {
    std::string dir = path.substr(0, slash);
    if (mkdir(dir.c_str(), 0755) != 0 && errno != EEXIST) return;
  }
}

}  // namespace

bool kdb_read(const char* key, std::string* value) {
  if (!valid_key(key) || value == nullptr) return false;
  FILE* f = std::fopen(key_path(key).c_str(), "rb");
  if (f == nullptr) return false;
  std::string text;
  char buffer[4096];
  size_t n;
  bool too_big = false;
  while ((n = std::fread(buffer, 1, sizeof buffer, f)) > 0) {
    text.append(buffer, n);
    if (static_cast<long>(text.size()) > kMaxValueBytes) {
      too_big = true;
      break;
    }
  }
  std::fclose(f);
  if (too_big) return false;
  if (!text.empty() && text.back() == '\n') text.pop_back();
  *value = std::move(text);
  return true;
}

bool kdb_write(const char* key, const char* value) {
  if (!valid_key(key)) return false;
  std::string path = key_path(key);
  if (value == nullptr) return std::remove(path.c_str()) == 0 || errno == ENOENT;
  make_parents(path);
  FILE* f = std::fopen(path.c_str(), "wb");
  if (f == nullptr) return false;
  size_t len = std::strlen(value);
  bool ok = std::fwrite(value, 1, len, f) == len;
  ok = (std::fclose(f) == 0) && ok;
  return ok;
}
