#include "platform/InstanceLock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "platform/SafePath.h"

namespace platform {

int acquireInstanceLock(const std::string& path) {
  SafeParent parent;
  if (int err = safeOpenParent(path, &parent)) {
    errno = err;
    return -1;
  }
  int fd = ::openat(parent.fd.get(), parent.name.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
  if (fd < 0) return -1;
  struct stat st;
  const int statted = ::fstat(fd, &st);
  if (statted != 0 || !S_ISREG(st.st_mode)) {
    const int error = statted != 0 ? errno : EINVAL;
    ::close(fd);
    errno = error;
    return -1;
  }
  if (::flock(fd, LOCK_EX | LOCK_NB) != 0) {
    const int error = errno;
    ::close(fd);
    errno = error;
    return -1;
  }
  return fd;
}

}  // namespace platform
