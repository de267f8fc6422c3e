// The service binary's way to the data pull: the module libsitedeck-pull.so
// in the binary's own directory (the build tree, a copy with its module) or,
// failing that, in the module directory of the installation, found from the
// binary's directory so that a staged or relocated installation finds its
// own; opened on the first initialize and kept for the life of the process. It resolves what it
// uses of the service (the database connection, the log, the row operations) from the binary, which
// exports them. Built into the service binary only; everywhere else the pull
// is linked in (sitedeck-service-pull-linked.cpp).
#include <dlfcn.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstring>
#include <string>

#include "sitedeck-service-log.h"
#include "sitedeck-service-pull.h"

namespace {

// Set once by the worker; later calls reuse it, a failure is tried again.
const sds_pull_calls* g_calls = nullptr;

// The directory of the running binary, with a trailing slash; empty when
// /proc does not tell.
std::string __sds_binary_dir(void) {
  char path[PATH_MAX];
  ssize_t length = readlink("/proc/self/exe", path, sizeof path - 1);
  if (length <= 0) return {};
  std::string text(path, static_cast<size_t>(length));
  size_t slash = text.rfind('/');
  return slash == std::string::npos ? std::string() : text.substr(0, slash + 1);
}

// Where the installation puts the module, relative to the binary's directory
// unless the build chose an absolute directory; empty without one.
std::string __sds_installed_module_path(const std::string& binary_dir) {
#ifdef SITEDECK_PULL_MODULE_INSTALL_DIR
  std::string dir = SITEDECK_PULL_MODULE_INSTALL_DIR;
  if (dir.empty()) return {};
  if (dir[0] != '/') dir = binary_dir + dir;
  return dir + "/" + SDS_PULL_MODULE_NAME;
#else
  (void)binary_dir;
  return {};
#endif
}

}  // namespace

const sds_pull_calls* sds_pull_get_calls(void) {
  if (g_calls != nullptr) return g_calls;
  std::string dir = __sds_binary_dir();
  if (dir.empty()) {
    SDS_LOGE("[CRITICAL] cannot find the service binary [%s]", strerror(errno));
    return nullptr;
  }
  std::string path = dir + SDS_PULL_MODULE_NAME;
  // A module beside the binary wins; the installed one is taken only when
  // none is there, and when neither exists the failure names the first place.
  std::string installed = __sds_installed_module_path(dir);
  if (access(path.c_str(), F_OK) != 0 && !installed.empty() &&
      access(installed.c_str(), F_OK) == 0) {
    path = installed;
  }
  // RTLD_NOW: a module that does not fit this binary fails here, not in the
  // middle of a pull. RTLD_LOCAL: its libraries stay out of everyone's way.
  void* module = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (module == nullptr) {
    SDS_LOGE("[CRITICAL] cannot load %s [%s]", path.c_str(), dlerror());
    return nullptr;
  }
  using calls_fn = const sds_pull_calls* (*)(void);
  auto get = reinterpret_cast<calls_fn>(dlsym(module, "sds_pull_module_calls"));
  const sds_pull_calls* calls = get != nullptr ? get() : nullptr;
  if (calls == nullptr || calls->check_data_pull_required == nullptr ||
      calls->remove_file == nullptr || calls->set_next_update_duration == nullptr) {
    SDS_LOGE("[CRITICAL] %s lacks the pull's entry points", path.c_str());
    (void)dlclose(module);
    return nullptr;
  }
  g_calls = calls;
  return g_calls;
}
