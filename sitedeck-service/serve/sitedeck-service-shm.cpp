// The POSIX shared-memory object that carries one icon's pixel rows to the
// browser (content: docs/protocol.md). Its name is machine-wide on purpose,
// since the browser opens it by that name, so it is never moved below
// $SITEDECK_ROOT. No descriptor outlives a call: a mapping stays valid without
// one, and a long connection with many icon requests must not pile them up.
// The icon requests share one mapping, kept for as long as the name leads to
// the object it maps: opening and mapping the object for every icon cost
// several times the copy of the icon itself.
//
// The object is open to every local process (mode 0666), so nothing about it
// is taken on trust: whatever stands at the name and is not a regular file is
// replaced when the object is made, a symlink is never followed, a size cut
// short is restored before an icon is copied, and a cut that comes during
// the copy is caught instead of killing the service with SIGBUS.
#include "serve/sitedeck-service-shm.h"

#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>

#include "security-server.h"
#include "sitedeck-service-log.h"
#include "sitedeck-service-paths.h"
#include "sitedeck-service-raii.h"
#include "sitedeck-service-types.h"

namespace {

// The browser's processes run as user and group "app".
constexpr char kAppAccount[] = "app";

void __sds_log_alloc_open_error(int err) {
  switch (err) {
    case EEXIST:
      SDS_LOGE("[CRITICAL] Failed to allocate shared memory , Already Exists");
      break;
    case EACCES:
      SDS_LOGE("[CRITICAL] Failed to allocate shared memory , Required root permission");
      break;
    case EINTR:
      SDS_LOGE("[CRITICAL] The shm_open() operation was interrupted by a signal.");
      break;
    case EINVAL:
      SDS_LOGE("[CRITICAL] The shm_open() operation is not supported for the given name.");
      break;
    case EMFILE:
      SDS_LOGE("[CRITICAL] Too many file descriptors are currently in use by this process.");
      break;
    case ENAMETOOLONG:
      SDS_LOGE(
          "[CRITICAL] The length of the name argument exceeds {PATH_MAX} or a pathname component "
          "is longer than {NAME_MAX}.");
      break;
    case ENOENT:
      SDS_LOGE("[CRITICAL] O_CREAT is not set and the named shared memory object does not exist.");
      break;
    case ENOSPC:
      SDS_LOGE("[CRITICAL] Failed to allocate shared memory , Resource is empty");
      break;
    default:
      break;
  }
}

void __sds_log_resize_error(int err) {
  switch (err) {
    case EINTR:
      SDS_LOGE("[CRITICAL] A signal was caught during execution.");
      break;
    case EINVAL:
      SDS_LOGE("[CRITICAL] The length argument was less than 0.");
      break;
    case EFBIG:
      SDS_LOGE("[CRITICAL] The length argument was greater than the maximum file size.");
      break;
    case EIO:
      SDS_LOGE("[CRITICAL] An I/O error occurred while reading from or writing to a file system.");
      break;
    case EBADF:
      SDS_LOGE("[CRITICAL] The fildes argument is not a file descriptor open for writing.");
      break;
    case EROFS:
      SDS_LOGE("[CRITICAL] The named file resides on a read-only file system.");
      break;
    default:
      break;
  }
}

void __sds_log_attach_open_error(int err) {
  switch (err) {
    case EACCES:
      SDS_LOGE("[CRITICAL] Required root permission");
      break;
    case EINTR:
      SDS_LOGE("[CRITICAL] The shm_open() operation was interrupted by a signal.");
      break;
    case EINVAL:
      SDS_LOGE("[CRITICAL] The shm_open() operation is not supported for the given name.");
      break;
    case EMFILE:
      SDS_LOGE("[CRITICAL] Too many file descriptors are currently in use by this process.");
      break;
    default:
      SDS_LOGE("[CRITICAL] Unknown error");
      break;
  }
}

void __sds_log_map_error(int err) {
  switch (err) {
    case EACCES:
      SDS_LOGE("[CRITICAL] The fildes argument is not open for read and write.\n");
      break;
    case EAGAIN:
      SDS_LOGE("[CRITICAL] The mapping could not be locked in memory\n");
      break;
    case EBADF:
      SDS_LOGE("[CRITICAL] The fildes argument is not a valid open file descriptor.");
      break;
    case EINVAL:
      SDS_LOGE("[CRITICAL] The value of len is zero.");
      break;
    default:
      break;
  }
}

// The mapping the icon requests share, and the object it maps.
struct kept_mapping {
  void* address = nullptr;
  dev_t device = 0;
  ino_t inode = 0;
};
kept_mapping g_kept;

// Set while command 7 copies into the kept mapping, and when that copy met a
// cut object; read by the SIGBUS handler on the same thread.
volatile sig_atomic_t g_copying = 0;
volatile sig_atomic_t g_copy_cut = 0;
struct sigaction g_previous_sigbus {};

// A write beyond the end of a cut object raises SIGBUS. When it hits the kept
// mapping during a copy, private memory takes the mapping's place, so that
// the copy finishes and the faulting write is simply done again; any other
// SIGBUS gets the action it had before, which the repeated fault then meets.
void __sds_shm_on_sigbus(int signal_number, siginfo_t* info, void* /*context*/) {
  auto* start = static_cast<char*>(g_kept.address);
  auto* fault = static_cast<char*>(info->si_addr);
  if (g_copying != 0 && start != nullptr && fault >= start && fault < start + SDS_SHM_SIZE &&
      mmap(start, SDS_SHM_SIZE, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS | MAP_FIXED, -1,
           0) != MAP_FAILED) {
    g_copy_cut = 1;
    return;
  }
  (void)sigaction(signal_number, &g_previous_sigbus, nullptr);
}

void __sds_shm_catch_sigbus(void) {
  static bool installed = false;
  if (installed) return;
  struct sigaction action {};
  action.sa_sigaction = __sds_shm_on_sigbus;
  action.sa_flags = SA_SIGINFO;
  (void)sigemptyset(&action.sa_mask);
  installed = sigaction(SIGBUS, &action, &g_previous_sigbus) == 0;
}

// Opens the object by name and maps all of it, logging failures as
// sds_attach_shm does; `object` gets the object's identity. A name that
// leads to something other than a regular file is refused (shm_open never
// follows a symlink), and an object cut short gets its size back first:
// writing beyond its end would raise SIGBUS.
void* __sds_map_object(struct stat* object) {
  UniqueFd fd(shm_open(SDS_SHM_NAME, O_RDWR, 0660));
  if (!fd) {
    __sds_log_attach_open_error(errno);
    return nullptr;
  }
  struct stat found {};
  if (fstat(fd.get(), &found) != 0 || !S_ISREG(found.st_mode)) {
    SDS_LOGE("[CRITICAL] %s is not a regular file", SDS_SHM_FILE_PATH);
    return nullptr;
  }
  if (found.st_size < static_cast<off_t>(SDS_SHM_SIZE)) {
    SDS_LOGE("[CRITICAL] %s cut to %lld bytes: size restored", SDS_SHM_FILE_PATH,
             static_cast<long long>(found.st_size));
    if (ftruncate(fd.get(), static_cast<off_t>(SDS_SHM_SIZE)) != 0) {
      __sds_log_resize_error(errno);
      return nullptr;
    }
  }
  void* address = mmap(nullptr, SDS_SHM_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED, fd.get(), 0);
  if (address == MAP_FAILED) {
    int err = errno;
    std::puts("Map failed");
    (void)std::fflush(stdout);
    __sds_log_map_error(err);
    return nullptr;
  }
  if (object != nullptr) *object = found;
  return address;
}

// Opens the object for sds_alloc_shm, creating it when missing. Something
// other than a regular file at the name (a directory, FIFO, socket, or a
// symlink, which shm_open does not follow) would make every connection fail:
// it is removed (a symlink itself, never its target) and the object made
// anew. On failure errno tells why.
UniqueFd __sds_open_for_alloc(void) {
  UniqueFd fd(shm_open(SDS_SHM_NAME, O_RDWR | O_CREAT, 0660));
  // With fs.protected_regular set (the default on many distributions), the
  // kernel refuses an O_CREAT open of an existing file in a sticky directory
  // such as /dev/shm when another account owns it, root included: exactly
  // the object of an earlier connection once handed to the browser's account.
  // Opening the existing object without O_CREAT is allowed, and is what this
  // call needs anyway.
  if (!fd && errno == EACCES) fd.reset(shm_open(SDS_SHM_NAME, O_RDWR, 0660));
  if (fd) {
    struct stat found {};
    if (fstat(fd.get(), &found) != 0) return UniqueFd();
    if (S_ISREG(found.st_mode)) return fd;
    fd.reset();
  } else {
    // Tell "nothing usable at the name" from "a regular file we may not open".
    int err = errno;
    struct stat entry {};
    if (lstat(SDS_SHM_FILE_PATH, &entry) != 0 || S_ISREG(entry.st_mode)) {
      errno = err;
      return fd;
    }
  }
  SDS_LOGE("[CRITICAL] %s is not a regular file: replaced", SDS_SHM_FILE_PATH);
  if (shm_unlink(SDS_SHM_NAME) != 0 && rmdir(SDS_SHM_FILE_PATH) != 0) {
    SDS_LOGE("[CRITICAL] %s could not be removed [%s]", SDS_SHM_FILE_PATH, strerror(errno));
    errno = EEXIST;
    return fd;
  }
  fd.reset(shm_open(SDS_SHM_NAME, O_RDWR | O_CREAT | O_EXCL, 0660));
  return fd;
}

// Hands the object to the browser's account. A system without that account
// (a development machine) keeps the creator as owner; the 0666 mode still lets
// every local process in.
void __sds_shm_give_to_app(int fd) {
  const struct passwd* user = getpwnam(kAppAccount);
  if (user == nullptr) return;
  uid_t uid = user->pw_uid;
  const struct group* group = getgrnam(kAppAccount);
  if (group == nullptr) return;
  (void)fchown(fd, uid, group->gr_gid);
}

}  // namespace

int sds_alloc_shm(void) {
  UniqueFd fd = __sds_open_for_alloc();
  if (!fd) {
    __sds_log_alloc_open_error(errno);
    return 0;
  }
  // The creation mode is narrowed by the umask; fchmod sets what the browser
  // needs regardless of it.
  (void)fchmod(fd.get(), 0666);
  __sds_shm_give_to_app(fd.get());
  if (security_server_label_access(SDS_SHM_FILE_PATH, SDS_SHM_LABEL) != 0) {
    SDS_LOGE("[CRITICAL] Failed to change the access label of file");
    return 0;
  }
  if (ftruncate(fd.get(), static_cast<off_t>(SDS_SHM_SIZE)) != 0) {
    __sds_log_resize_error(errno);
    return 0;
  }
  return 1;
}

int sds_free_shm(void) {
  if (shm_unlink(SDS_SHM_NAME) != 0) {
    SDS_LOGE("[CRITICAL] Error removing %s\n", SDS_SHM_NAME);
    return 0;
  }
  return 1;
}

void* sds_attach_shm(void) { return __sds_map_object(nullptr); }

void* sds_shm_kept_mapping(void) {
  struct stat named {};
  if (g_kept.address != nullptr && lstat(SDS_SHM_FILE_PATH, &named) == 0 &&
      named.st_dev == g_kept.device && named.st_ino == g_kept.inode &&
      named.st_size >= static_cast<off_t>(SDS_SHM_SIZE)) {
    return g_kept.address;
  }
  // Removed, made anew or cut short by someone else: map what the name
  // leads to now, as a fresh attach for this request would.
  sds_shm_drop_kept_mapping();
  __sds_shm_catch_sigbus();
  struct stat object {};
  void* address = __sds_map_object(&object);
  if (address != nullptr) g_kept = {address, object.st_dev, object.st_ino};
  return address;
}

void sds_shm_drop_kept_mapping(void) {
  if (g_kept.address != nullptr) (void)munmap(g_kept.address, SDS_SHM_SIZE);
  g_kept = {};
}

void sds_shm_copy_begin(void) {
  g_copy_cut = 0;
  g_copying = 1;
}

bool sds_shm_copy_end(void) {
  g_copying = 0;
  if (g_copy_cut == 0) return true;
  g_copy_cut = 0;
  // The mapping is private memory now; the next icon maps the object again.
  sds_shm_drop_kept_mapping();
  return false;
}

int sds_dettach_shm(void* address) {
  if (address == nullptr) {
    SDS_LOGE("[CRITICAL] Invalid memory Address");
    return 0;
  }
  if (munmap(address, SDS_SHM_SIZE) != 0) {
    if (errno == EINVAL) {
      SDS_LOGE("[CRITICAL] The value specified for the argument is not correct.\n");
    } else {
      SDS_LOGE("[CRITICAL] Unknown system state.\n");
    }
    return 0;
  }
  return 1;
}
