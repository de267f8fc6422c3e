// Scratch root, quiet logs and the scratch database of the fuzz targets.
#include "fuzz_support.h"

#include <glib.h>
#include <sqlite3.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "database/sitedeck-service-db-interface.h"
#include "dlog.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"

namespace {

std::string g_root;

void remove_root(void) {
  std::error_code ec;
  if (!g_root.empty()) std::filesystem::remove_all(g_root, ec);
}

[[noreturn]] void fail(const char* what) {
  std::fprintf(stderr, "fuzz set-up failed: %s\n", what);
  std::abort();
}

}  // namespace

const std::string& fuzz_root(void) {
  if (!g_root.empty()) return g_root;
  // SITEDECK_FUZZ_LOG=1 keeps the service's log lines, for triage.
  const char* log = std::getenv("SITEDECK_FUZZ_LOG");
  if (log == nullptr || std::strcmp(log, "1") != 0) {
    dlog_set_quiet(true);
    g_set_print_handler([](const gchar*) {});
  }
  std::error_code ec;
  std::filesystem::path base = std::filesystem::temp_directory_path(ec);
  if (ec) base = "/tmp";
  std::string templ = (base / "sitedeck-fuzz-XXXXXX").string();
  if (mkdtemp(templ.data()) == nullptr) fail("mkdtemp");
  g_root = templ;
  std::atexit(remove_root);
  for (const char* sub : {SDS_SERVER_DIR, SDS_DATABASE_DIR, SDS_IMAGES_DIR,
                          "/opt/data/browser-sitedeck-service", "/opt/var/kdb"}) {
    std::filesystem::create_directories(g_root + sub, ec);
    if (ec) fail("create_directories");
  }
  if (setenv("SITEDECK_ROOT", g_root.c_str(), 1) != 0) fail("setenv");
  return g_root;
}

std::string fuzz_path(const char* fixed) { return fuzz_root() + fixed; }

void fuzz_write_file(const std::string& path, const uint8_t* data, size_t size) {
  UniqueFile file(std::fopen(path.c_str(), "wb"));
  if (!file) fail("fopen");
  if (size > 0 && std::fwrite(data, 1, size, file.get()) != size) fail("fwrite");
  if (std::fclose(file.release()) != 0) fail("fclose");
}

void fuzz_open_database(void) {
  (void)fuzz_root();
  if (sds_db_handle != nullptr) return;
  if (sds_ensure_db_open() != SDS_ERROR_NONE) fail("sds_ensure_db_open");
  fuzz_exec("PRAGMA synchronous=OFF");
  fuzz_exec("PRAGMA journal_mode=MEMORY");
}

void fuzz_exec(const char* sql) {
  char* message = nullptr;
  if (sqlite3_exec(sds_db_handle, sql, nullptr, nullptr, &message) != SQLITE_OK) {
    std::fprintf(stderr, "%s: %s\n", sql, message != nullptr ? message : "?");
    sqlite3_free(message);
    fail("sqlite3_exec");
  }
}
