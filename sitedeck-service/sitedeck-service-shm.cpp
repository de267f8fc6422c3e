// The POSIX shared-memory object that carries one icon's pixel rows to the
// browser (content: docs/protocol.md). Its name is machine-wide on purpose,
// since the browser opens it by that name, so it is never moved below
// $SITEDECK_ROOT. No descriptor outlives a call: a mapping stays valid without
// one, and a long connection with many icon requests must not pile them up.
// The icon requests share one mapping, kept for as long as the name leads to
// the object it maps: opening and mapping the object for every icon cost
// several times the copy of the icon itself.
#include "sitedeck-service-shm.h"

#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

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

// Opens the object by name and maps all of it, logging failures as
// sds_attach_shm does; `object` gets the object's identity.
void* __sds_map_object(struct stat* object) {
  UniqueFd fd(shm_open(SDS_SHM_NAME, O_RDWR, 0660));
  if (!fd) {
    __sds_log_attach_open_error(errno);
    return nullptr;
  }
  void* address = mmap(nullptr, SDS_SHM_SIZE, PROT_READ | PROT_WRITE, MAP_SHARED, fd.get(), 0);
  if (address == MAP_FAILED) {
    int err = errno;
    std::puts("Map failed");
    (void)std::fflush(stdout);
    __sds_log_map_error(err);
    return nullptr;
  }
  if (object != nullptr && fstat(fd.get(), object) != 0) *object = {};
  return address;
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
  UniqueFd fd(shm_open(SDS_SHM_NAME, O_RDWR | O_CREAT, 0660));
  // With fs.protected_regular set (the default on many distributions), the
  // kernel refuses an O_CREAT open of an existing file in a sticky directory
  // such as /dev/shm when another account owns it, root included: exactly
  // the object of an earlier connection once handed to the browser's account.
  // Opening the existing object without O_CREAT is allowed, and is what this
  // call needs anyway.
  if (!fd && errno == EACCES) fd.reset(shm_open(SDS_SHM_NAME, O_RDWR, 0660));
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
  if (g_kept.address != nullptr && stat(SDS_SHM_FILE_PATH, &named) == 0 &&
      named.st_dev == g_kept.device && named.st_ino == g_kept.inode) {
    return g_kept.address;
  }
  // Removed or made anew by someone else: map what the name leads to now,
  // as a fresh attach for this request would.
  sds_shm_drop_kept_mapping();
  struct stat object {};
  void* address = __sds_map_object(&object);
  // An object whose identity fstat could not tell never matches the name,
  // so its mapping is made anew (and this one unmapped) next time.
  if (address != nullptr) g_kept = {address, object.st_dev, object.st_ino};
  return address;
}

void sds_shm_drop_kept_mapping(void) {
  if (g_kept.address != nullptr) (void)munmap(g_kept.address, SDS_SHM_SIZE);
  g_kept = {};
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
