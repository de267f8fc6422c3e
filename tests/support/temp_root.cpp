#include "support/temp_root.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "sitedeck-service-paths.h"

TempRoot::TempRoot() {
  const char* previous = std::getenv("SITEDECK_ROOT");
  if (previous != nullptr) {
    had_previous_ = true;
    previous_ = previous;
  }
  std::string templ = (std::filesystem::temp_directory_path() / "sitedeck-test-XXXXXX").string();
  char* made = mkdtemp(templ.data());
  if (made != nullptr) dir_ = made;
  for (const char* sub : {SDS_SERVER_DIR, SDS_DATABASE_DIR, SDS_IMAGES_DIR,
                          "/opt/data/browser-sitedeck-service", "/opt/var/kdb"}) {
    std::filesystem::create_directories(dir_ + sub);
  }
  setenv("SITEDECK_ROOT", dir_.c_str(), 1);
}

TempRoot::~TempRoot() {
  std::error_code ec;
  if (!dir_.empty()) std::filesystem::remove_all(dir_, ec);
  if (had_previous_) {
    setenv("SITEDECK_ROOT", previous_.c_str(), 1);
  } else {
    unsetenv("SITEDECK_ROOT");
  }
}

std::string read_file(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream out;
  out << in.rdbuf();
  return out.str();
}

bool write_file(const std::string& path, const std::string& content) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << content;
  return static_cast<bool>(out);
}

bool file_exists(const std::string& path) {
  struct stat st {};
  return stat(path.c_str(), &st) == 0;
}
