#include "Daemon/fileops/QRTFileManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <fts.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <climits>
#include <cstring>
#include <memory>
#include <new>
#include <thread>
#include <utility>

#include "base/PlistCodec.h"
#include "platform/LockState.h"
#include "platform/Log.h"

using platform::kLogError;
using platform::kLogNotice;

namespace {

constexpr const char* kProtectionClassAttribute = "trusted.com.norvane.protection-class";
constexpr const char* kAccessAclAttribute = "system.posix_acl_access";
constexpr const char* kDefaultAclAttribute = "system.posix_acl_default";
constexpr size_t kDirentBufferSize = 32 * 1024;
constexpr size_t kParallelUnlinkThreshold = 64;
constexpr unsigned kUnlinkThreads = 4;
// Deeper trees than this are walked with only this many directories open;
// the rest are reopened through ".." on the way back up.
constexpr size_t kMaxOpenDirectories = 64;
// Property-list files are small; anything beyond this is not one of ours.
constexpr off_t kMaxPropertyListFileSize = 64 << 20;

const char* errorText(int err) { return strerror(err); }

class UniqueFd {
 public:
  explicit UniqueFd(int fd = -1) : fd_(fd) {}
  UniqueFd(UniqueFd&& o) noexcept : fd_(o.release()) {}
  UniqueFd& operator=(UniqueFd&& o) noexcept {
    reset(o.release());
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  ~UniqueFd() { reset(); }
  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  int release() { return std::exchange(fd_, -1); }
  void reset(int fd = -1) {
    if (fd_ >= 0) close(fd_);
    fd_ = fd;
  }

 private:
  int fd_;
};

struct DirCloser {
  void operator()(DIR* d) const { closedir(d); }
};
using UniqueDir = std::unique_ptr<DIR, DirCloser>;

bool isDotOrDotDot(const char* name) {
  return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

// O_NOATIME spares an inode write per directory but needs ownership or
// CAP_FOWNER, hence the retry without it.
int openNoFollow(int dirfd, const char* name, int flags) {
  flags |= O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
  int fd = openat(dirfd, name, flags | O_NOATIME);
  if (fd < 0 && errno == EPERM) fd = openat(dirfd, name, flags);
  return fd;
}

int openDirectoryAt(int dirfd, const char* name) { return openNoFollow(dirfd, name, O_RDONLY | O_DIRECTORY); }

// ---------------------------------------------------------------------------
// Recursive removal.

// Removes a tree depth first without following links or leaving the root's
// device. Entries that cannot be removed are reported to entryFailed and the
// walk goes on; the first such errno is kept. The files of a large directory
// are unlinked by a few threads at once.
class TreePruner {
 public:
  explicit TreePruner(const char* root) : path_(root) {}
  // 0 when the walk reached its end, else the errno that stopped it.
  int run();
  int firstError() const { return firstError_.load(); }

 private:
  struct Frame {
    UniqueFd fd;
    dev_t dev;
    ino_t ino;
    size_t parentPathLength;  // to cut path_ back on the way up
    std::string name;
    std::vector<std::string> subdirectories;
    size_t next = 0;
  };
  struct Victim {
    ino64_t inode;
    size_t nameOffset;  // into names_
  };

  void scan(Frame& frame);
  void enter(const std::string& name);
  int leave();
  int reopen(Frame& frame, int childFd);
  void removeAt(int dirfd, const char* name, int flags, const std::string& path);
  void entryFailed(int dirfd, const char* name, const std::string& path, int err);
  bool unsetImmutable(int dirfd, const char* name, const std::string& path);
  void record(const std::string& path, int err);
  void unlinkVictims(Frame& frame);
  void keepFirst(int err) {
    int expected = 0;
    firstError_.compare_exchange_strong(expected, err);
  }
  std::string childPath(const char* name) const { return path_ + "/" + name; }

  std::string path_;  // the path of the directory on top of the stack
  std::vector<Frame> stack_;
  std::unique_ptr<char[]> buffer_;
  std::vector<Victim> victims_;  // scratch of scan()
  std::string names_;
  dev_t rootDevice_ = 0;
  std::atomic<int> firstError_{0};  // entryFailed runs on several threads
};

int TreePruner::run() {
  UniqueFd fd(openDirectoryAt(AT_FDCWD, path_.c_str()));
  if (!fd.valid()) {
    int err = errno;
    if (err != ENOTDIR && err != ELOOP) return err;
    removeAt(AT_FDCWD, path_.c_str(), 0, path_);  // a file or a link
    return 0;
  }
  struct stat st;
  if (fstat(fd.get(), &st) != 0) return errno;
  rootDevice_ = st.st_dev;
  buffer_ = std::make_unique<char[]>(kDirentBufferSize);
  stack_.push_back(Frame{std::move(fd), st.st_dev, st.st_ino, path_.size(), path_, {}});
  scan(stack_.back());
  while (!stack_.empty()) {
    Frame& top = stack_.back();
    if (top.next < top.subdirectories.size()) {
      std::string name = std::move(top.subdirectories[top.next++]);
      enter(name);
    } else if (int err = leave()) {
      return err;
    }
  }
  return 0;
}

// Reads the whole directory, then unlinks everything but directories in
// inode order, which on ext4 is about the order of allocation and keeps the
// inode table and bitmap updates close together. Directories wait in the
// frame.
void TreePruner::scan(Frame& frame) {
  victims_.clear();
  names_.clear();
  for (bool more = true; more;) {
    ssize_t n = getdents64(frame.fd.get(), buffer_.get(), kDirentBufferSize);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) record(path_, errno);
    more = n > 0;
    for (ssize_t offset = 0; offset < n;) {
      auto* entry = reinterpret_cast<struct dirent64*>(buffer_.get() + offset);
      offset += entry->d_reclen;
      const char* name = entry->d_name;
      if (isDotOrDotDot(name)) continue;
      if (entry->d_type == DT_DIR) {
        frame.subdirectories.emplace_back(name);
      } else {
        victims_.push_back({entry->d_ino, names_.size()});
        names_.append(name, strlen(name) + 1);
      }
    }
  }
  std::sort(victims_.begin(), victims_.end(), [](const Victim& a, const Victim& b) { return a.inode < b.inode; });
  unlinkVictims(frame);
}

// An unlink spends most of its time after the directory lock is dropped
// (freeing the inode, and on a disk with online discard waiting for the
// discard), so several threads on one directory overlap that wait. Threads
// take interleaved shares to keep the overall order by inode.
void TreePruner::unlinkVictims(Frame& frame) {
  const size_t count = victims_.size();
  const unsigned threads = count >= kParallelUnlinkThreshold ? kUnlinkThreads : 1;
  std::vector<std::vector<std::string>> directories(threads);
  auto share = [&](unsigned t) {
    try {
      for (size_t i = t; i < count; i += threads) {
        const char* name = names_.data() + victims_[i].nameOffset;
        if (unlinkat(frame.fd.get(), name, 0) == 0) continue;
        int err = errno;
        if (err == EISDIR) {  // the file system gave no type
          directories[t].emplace_back(name);
        } else {
          entryFailed(frame.fd.get(), name, childPath(name), err);
        }
      }
    } catch (const std::exception&) {
      keepFirst(ENOMEM);
    }
  };
  std::vector<std::thread> helpers;
  unsigned started = 1;
  try {
    for (; started < threads; ++started) helpers.emplace_back(share, started);
  } catch (const std::exception&) {
    // No thread to be had: the rest of the shares run here.
  }
  share(0);
  for (unsigned t = started; t < threads; ++t) share(t);
  for (std::thread& helper : helpers) helper.join();
  for (auto& found : directories)
    for (std::string& name : found) frame.subdirectories.push_back(std::move(name));
}

void TreePruner::enter(const std::string& name) {
  int parentFd = stack_.back().fd.get();
  UniqueFd fd(openDirectoryAt(parentFd, name.c_str()));
  if (!fd.valid()) {
    int err = errno;
    if (err == ENOTDIR || err == ELOOP) {
      removeAt(parentFd, name.c_str(), 0, childPath(name.c_str()));  // replaced meanwhile
    } else {
      entryFailed(parentFd, name.c_str(), childPath(name.c_str()), err);
    }
    return;
  }
  struct stat st;
  if (fstat(fd.get(), &st) != 0) {
    entryFailed(parentFd, name.c_str(), childPath(name.c_str()), errno);
    return;
  }
  if (st.st_dev != rootDevice_) {
    // A mount point: never wipe another file system; its removal fails (EBUSY).
    fd.reset();
    removeAt(parentFd, name.c_str(), AT_REMOVEDIR, childPath(name.c_str()));
    return;
  }
  if (stack_.size() >= kMaxOpenDirectories) stack_[stack_.size() - kMaxOpenDirectories].fd.reset();
  size_t parentLength = path_.size();
  path_ += '/';
  path_ += name;
  stack_.push_back(Frame{std::move(fd), st.st_dev, st.st_ino, parentLength, name, {}});
  scan(stack_.back());
}

// Pops the finished directory and removes it from its parent.
int TreePruner::leave() {
  Frame child = std::move(stack_.back());
  stack_.pop_back();
  if (stack_.empty()) {
    child.fd.reset();
    removeAt(AT_FDCWD, path_.c_str(), AT_REMOVEDIR, path_);
    return 0;
  }
  Frame& parent = stack_.back();
  if (!parent.fd.valid()) {
    if (int err = reopen(parent, child.fd.get())) return err;
  }
  child.fd.reset();
  removeAt(parent.fd.get(), child.name.c_str(), AT_REMOVEDIR, path_);
  path_.resize(child.parentPathLength);
  return 0;
}

// Reopens a directory closed for depth through its child's "..", and refuses
// to go on when that is no longer the directory we came from.
int TreePruner::reopen(Frame& frame, int childFd) {
  UniqueFd fd(openDirectoryAt(childFd, ".."));
  if (!fd.valid()) return errno;
  struct stat st;
  if (fstat(fd.get(), &st) != 0) return errno;
  if (st.st_dev != frame.dev || st.st_ino != frame.ino) return ESTALE;
  frame.fd = std::move(fd);
  return 0;
}

void TreePruner::removeAt(int dirfd, const char* name, int flags, const std::string& path) {
  if (unlinkat(dirfd, name, flags) != 0) entryFailed(dirfd, name, path, errno);
}

// The per-entry error hook: an entry that is only in the way because of its
// immutable flag loses the flag and is unlinked; every other failure is
// logged and the first one kept.
void TreePruner::entryFailed(int dirfd, const char* name, const std::string& path, int err) {
  if (err == ENOENT) return;  // gone already
  QRTLog(kLogError, "prunetree hit error for %s : %s", path.c_str(), errorText(err));
  if (err == EPERM && unsetImmutable(dirfd, name, path)) {
    if (unlinkat(dirfd, name, 0) == 0) return;
    QRTLog(kLogError, "unlink of %s failed: %s", path.c_str(), errorText(errno));
  }
  keepFirst(err);
}

void TreePruner::record(const std::string& path, int err) {
  QRTLog(kLogError, "prunetree hit error for %s : %s", path.c_str(), errorText(err));
  keepFirst(err);
}

// The flags live behind an open file; links and special files never carry
// the flag we repair, and opening them could block or have side effects.
bool TreePruner::unsetImmutable(int dirfd, const char* name, const std::string& path) {
  struct stat st;
  if (fstatat(dirfd, name, &st, AT_SYMLINK_NOFOLLOW) != 0) {
    QRTLog(kLogError, "Failed to stat %s before unsetting UF_IMMUTABLE: %s", path.c_str(), errorText(errno));
    return false;
  }
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) return false;
  UniqueFd fd(openNoFollow(dirfd, name, O_RDONLY | O_NOCTTY));
  int flags = 0;
  if (!fd.valid() || ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) {
    if (errno == ENOTTY || errno == EOPNOTSUPP) return false;  // no flags on this file system
    QRTLog(kLogError, "Failed to stat %s before unsetting UF_IMMUTABLE: %s", path.c_str(), errorText(errno));
    return false;
  }
  if (!(flags & FS_IMMUTABLE_FL)) return false;
  flags &= ~FS_IMMUTABLE_FL;
  if (ioctl(fd.get(), FS_IOC_SETFLAGS, &flags) != 0) {
    QRTLog(kLogError, "Failed to lchflags %s: %s", path.c_str(), errorText(errno));
    return false;
  }
  QRTLog(kLogNotice, "Unset UF_IMMUTABLE on %s", path.c_str());
  return true;
}

// ---------------------------------------------------------------------------
// Recursive copy.

// Copies a tree with data, owner, mode, times and every extended attribute
// (ACLs included), links as links, never following one at either end. A
// directory's own attributes are set after its contents, so that neither its
// mode nor its default ACL can get in the way of the copy below it.
class TreeCloner {
 public:
  int run(const char* src, const char* dst);

 private:
  struct Frame {
    UniqueDir src;
    UniqueFd dst;
    struct stat st;
  };

  int copyEntry(int sdir, const char* sname, int ddir, const char* dname, unsigned char type);
  int enterDirectory(int sdir, const char* sname, int ddir, const char* dname);
  int walk();
  int finishDirectory(Frame& frame);
  int copyFile(int sdir, const char* sname, int ddir, const char* dname);
  int copyData(int sfd, int dfd, off_t size);
  int copySymlink(int sdir, const char* sname, int ddir, const char* dname);
  int copySpecial(int sdir, const char* sname, int ddir, const char* dname);
  int finishItem(int sfd, int dfd, const struct stat& st, bool isDirectory);
  int copyXattrs(int sfd, int dfd, bool isDirectory);
  ssize_t readXattrList(int sfd);
  ssize_t readXattr(int sfd, const char* name);

  std::vector<Frame> stack_;
  std::vector<char> names_ = std::vector<char>(4096);
  std::vector<char> value_ = std::vector<char>(4096);
  std::unique_ptr<char[]> dataBuffer_;
  dev_t dstRootDevice_ = 0;
  ino_t dstRootInode_ = 0;
  // Items created under a directory with a default ACL inherit ACLs the
  // source may not have; those are then taken away again.
  bool dropInheritedAcls_ = true;
};

constexpr size_t kCopyBufferSize = 128 * 1024;

unsigned char typeOfMode(mode_t mode) {
  if (S_ISDIR(mode)) return DT_DIR;
  if (S_ISREG(mode)) return DT_REG;
  if (S_ISLNK(mode)) return DT_LNK;
  return DT_UNKNOWN;
}

int TreeCloner::run(const char* src, const char* dst) {
  struct stat st;
  if (lstat(src, &st) != 0) return errno;
  if (!S_ISDIR(st.st_mode)) return copyEntry(AT_FDCWD, src, AT_FDCWD, dst, typeOfMode(st.st_mode));
  if (int err = enterDirectory(AT_FDCWD, src, AT_FDCWD, dst)) return err;
  struct stat dstStat;
  if (fstat(stack_.back().dst.get(), &dstStat) != 0) return errno;
  dstRootDevice_ = dstStat.st_dev;
  dstRootInode_ = dstStat.st_ino;
  dropInheritedAcls_ = fgetxattr(stack_.back().dst.get(), kDefaultAclAttribute, nullptr, 0) >= 0;
  return walk();
}

int TreeCloner::walk() {
  while (!stack_.empty()) {
    Frame& top = stack_.back();
    errno = 0;
    struct dirent* entry = readdir(top.src.get());
    if (!entry) {
      if (errno != 0) return errno;
      int err = finishDirectory(top);
      stack_.pop_back();
      if (err) return err;
      continue;
    }
    if (isDotOrDotDot(entry->d_name)) continue;
    int sdir = dirfd(top.src.get());
    if (int err = copyEntry(sdir, entry->d_name, top.dst.get(), entry->d_name, entry->d_type)) return err;
  }
  return 0;
}

int TreeCloner::copyEntry(int sdir, const char* sname, int ddir, const char* dname, unsigned char type) {
  if (type == DT_UNKNOWN) {
    struct stat st;
    if (fstatat(sdir, sname, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
    type = typeOfMode(st.st_mode);
  }
  switch (type) {
    case DT_DIR:
      return enterDirectory(sdir, sname, ddir, dname);
    case DT_REG:
      return copyFile(sdir, sname, ddir, dname);
    case DT_LNK:
      return copySymlink(sdir, sname, ddir, dname);
    default:
      return copySpecial(sdir, sname, ddir, dname);
  }
}

// An existing directory at the destination is copied into.
int TreeCloner::enterDirectory(int sdir, const char* sname, int ddir, const char* dname) {
  UniqueFd sfd(openDirectoryAt(sdir, sname));
  if (!sfd.valid()) return errno;
  struct stat st;
  if (fstat(sfd.get(), &st) != 0) return errno;
  if (st.st_dev == dstRootDevice_ && st.st_ino == dstRootInode_) return EINVAL;  // a copy into itself
  if (mkdirat(ddir, dname, S_IRWXU) != 0 && errno != EEXIST) return errno;
  UniqueFd dfd(openDirectoryAt(ddir, dname));
  if (!dfd.valid()) return errno;
  UniqueDir dir(fdopendir(sfd.get()));
  if (!dir) return errno;
  sfd.release();
  stack_.push_back(Frame{std::move(dir), std::move(dfd), st});
  return 0;
}

int TreeCloner::finishDirectory(Frame& frame) {
  return finishItem(dirfd(frame.src.get()), frame.dst.get(), frame.st, true);
}

int TreeCloner::copyFile(int sdir, const char* sname, int ddir, const char* dname) {
  UniqueFd sfd(openNoFollow(sdir, sname, O_RDONLY | O_NOCTTY));
  if (!sfd.valid()) return errno;
  struct stat st;
  if (fstat(sfd.get(), &st) != 0) return errno;
  if (!S_ISREG(st.st_mode)) return ESTALE;  // replaced during the copy
  const int flags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
  UniqueFd dfd(openat(ddir, dname, flags, S_IRUSR | S_IWUSR));
  if (!dfd.valid() && errno == EEXIST) {
    if (unlinkat(ddir, dname, 0) != 0) return errno;
    dfd.reset(openat(ddir, dname, flags, S_IRUSR | S_IWUSR));
  }
  if (!dfd.valid()) return errno;
  if (int err = copyData(sfd.get(), dfd.get(), st.st_size)) return err;
  if (int err = finishItem(sfd.get(), dfd.get(), st, false)) return err;
  if (close(dfd.release()) != 0) return errno;
  return 0;
}

// In-kernel copy where the file systems allow it, plain reads and writes
// where they do not. Copies the size the file had when it was opened.
int TreeCloner::copyData(int sfd, int dfd, off_t size) {
  while (size > 0) {
    ssize_t n = copy_file_range(sfd, nullptr, dfd, nullptr, static_cast<size_t>(size), 0);
    if (n > 0) {
      size -= n;
      continue;
    }
    if (n == 0) return 0;
    if (errno == EINTR) continue;
    if (errno != EXDEV && errno != EINVAL && errno != ENOSYS && errno != EOPNOTSUPP) return errno;
    break;
  }
  if (size <= 0) return 0;
  if (!dataBuffer_) dataBuffer_ = std::make_unique<char[]>(kCopyBufferSize);
  while (size > 0) {
    ssize_t n = read(sfd, dataBuffer_.get(), kCopyBufferSize);
    if (n == 0) return 0;
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    for (ssize_t done = 0; done < n;) {
      ssize_t w = write(dfd, dataBuffer_.get() + done, static_cast<size_t>(n - done));
      if (w < 0 && errno == EINTR) continue;
      if (w < 0) return errno;
      done += w;
    }
    size -= n;
  }
  return 0;
}

// Links carry no mode and no extended attributes here, only owner and times.
int TreeCloner::copySymlink(int sdir, const char* sname, int ddir, const char* dname) {
  struct stat st;
  if (fstatat(sdir, sname, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (!S_ISLNK(st.st_mode)) return ESTALE;
  char target[PATH_MAX + 1];
  ssize_t n = readlinkat(sdir, sname, target, sizeof target);
  if (n < 0) return errno;
  if (static_cast<size_t>(n) >= sizeof target) return ENAMETOOLONG;
  target[n] = '\0';
  if (symlinkat(target, ddir, dname) != 0) {
    if (errno != EEXIST || unlinkat(ddir, dname, 0) != 0 || symlinkat(target, ddir, dname) != 0) return errno;
  }
  if (fchownat(ddir, dname, st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  if (utimensat(ddir, dname, times, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  return 0;
}

// FIFOs, sockets and device nodes: made anew, owner, mode and times kept.
int TreeCloner::copySpecial(int sdir, const char* sname, int ddir, const char* dname) {
  struct stat st;
  if (fstatat(sdir, sname, &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  const mode_t mode = st.st_mode & (S_IFMT | S_IRWXU);
  if (mknodat(ddir, dname, mode, st.st_rdev) != 0) {
    if (errno != EEXIST || unlinkat(ddir, dname, 0) != 0 || mknodat(ddir, dname, mode, st.st_rdev) != 0)
      return errno;
  }
  if (fchownat(ddir, dname, st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (fchmodat(ddir, dname, st.st_mode & 07777, 0) != 0) return errno;
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  if (utimensat(ddir, dname, times, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  return 0;
}

// Owner before mode (a change of owner clears set-id bits), the ACL before
// the mode (both set the group class bits and agree), times last.
int TreeCloner::finishItem(int sfd, int dfd, const struct stat& st, bool isDirectory) {
  if (fchown(dfd, st.st_uid, st.st_gid) != 0) return errno;
  if (int err = copyXattrs(sfd, dfd, isDirectory)) return err;
  if (fchmod(dfd, st.st_mode & 07777) != 0) return errno;
  const struct timespec times[2] = {st.st_atim, st.st_mtim};
  if (futimens(dfd, times) != 0) return errno;
  return 0;
}

// Most files have few short attributes; the buffers grow on demand only.
ssize_t TreeCloner::readXattrList(int sfd) {
  for (;;) {
    ssize_t n = flistxattr(sfd, names_.data(), names_.size());
    if (n >= 0 || errno != ERANGE) return n;
    ssize_t needed = flistxattr(sfd, nullptr, 0);
    if (needed < 0) return needed;
    names_.resize(static_cast<size_t>(needed) + 1);
  }
}

ssize_t TreeCloner::readXattr(int sfd, const char* name) {
  for (;;) {
    ssize_t n = fgetxattr(sfd, name, value_.data(), value_.size());
    if (n >= 0 || errno != ERANGE) return n;
    ssize_t needed = fgetxattr(sfd, name, nullptr, 0);
    if (needed < 0) return needed;
    value_.resize(static_cast<size_t>(needed) + 1);
  }
}

bool startsWith(const char* s, const char* prefix) { return strncmp(s, prefix, strlen(prefix)) == 0; }

int TreeCloner::copyXattrs(int sfd, int dfd, bool isDirectory) {
  ssize_t length = readXattrList(sfd);
  if (length < 0) {
    if (errno != EOPNOTSUPP) return errno;
    length = 0;
  }
  bool hasAccessAcl = false, hasDefaultAcl = false;
  for (const char* name = names_.data(); name < names_.data() + length; name += strlen(name) + 1) {
    ssize_t size = readXattr(sfd, name);
    if (size < 0) {
      if (errno == ENODATA) continue;  // removed meanwhile
      return errno;
    }
    if (fsetxattr(dfd, name, value_.data(), static_cast<size_t>(size), 0) != 0) {
      // Labels and user data a target cannot hold are left behind; ACLs and
      // trusted attributes (the protection class) never are.
      bool optional = startsWith(name, "user.") || startsWith(name, "security.");
      if (errno != EOPNOTSUPP || !optional) return errno;
    }
    hasAccessAcl |= strcmp(name, kAccessAclAttribute) == 0;
    hasDefaultAcl |= strcmp(name, kDefaultAclAttribute) == 0;
  }
  if (!dropInheritedAcls_) return 0;
  if (!hasAccessAcl && fremovexattr(dfd, kAccessAclAttribute) != 0 && errno != ENODATA && errno != EOPNOTSUPP)
    return errno;
  if (isDirectory && !hasDefaultAcl && fremovexattr(dfd, kDefaultAclAttribute) != 0 && errno != ENODATA &&
      errno != EOPNOTSUPP)
    return errno;
  return 0;
}

// ---------------------------------------------------------------------------
// Create with parents.

// Like mkdir -p: finds the deepest existing ancestor going up, then creates
// the missing ones going down. Returns 0, EEXIST for an existing path, or
// the errno that stopped it.
int ensureDirectories(const std::string& path, mode_t mode) {
  if (mkdirat(AT_FDCWD, path.c_str(), mode) == 0) return 0;
  if (errno != ENOENT) return errno;
  std::vector<size_t> missing{path.size()};
  for (size_t end = path.size();;) {
    size_t slash = path.rfind('/', end - 1);
    if (slash == std::string::npos || slash == 0) break;
    end = slash;
    std::string parent = path.substr(0, end);
    if (mkdirat(AT_FDCWD, parent.c_str(), mode) == 0 || errno == EEXIST) break;
    if (errno != ENOENT) return errno;
    missing.push_back(end);
  }
  for (auto it = missing.rbegin(); it != missing.rend(); ++it) {
    std::string prefix = path.substr(0, *it);
    if (mkdirat(AT_FDCWD, prefix.c_str(), mode) != 0 && errno != EEXIST) return errno;
  }
  return 0;
}

// ---------------------------------------------------------------------------
// Property-list files.

int writeAll(int fd, const plist::Data& bytes) {
  for (size_t done = 0; done < bytes.size();) {
    ssize_t n = write(fd, bytes.data() + done, bytes.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return errno;
    done += static_cast<size_t>(n);
  }
  return 0;
}

// A link planted at the destination is replaced, never written through. The
// temporary name is hidden so that directory listings pass over it.
int writeAtomically(const std::string& path, const plist::Data& bytes) {
  const size_t slash = path.rfind('/');
  const size_t nameStart = slash == std::string::npos ? 0 : slash + 1;
  const std::string directory = slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
  std::string temp = path.substr(0, nameStart) + "." + path.substr(nameStart) + ".XXXXXX";
  UniqueFd fd(mkostemp(temp.data(), O_CLOEXEC));
  if (!fd.valid()) return errno;
  int err = fchmod(fd.get(), S_IRUSR | S_IWUSR | S_IRGRP | S_IROTH) != 0 ? errno : 0;
  if (!err) err = writeAll(fd.get(), bytes);
  if (!err && fsync(fd.get()) != 0) err = errno;
  if (!err && close(fd.release()) != 0) err = errno;
  if (!err && rename(temp.c_str(), path.c_str()) != 0) err = errno;
  if (err) {
    unlink(temp.c_str());
    return err;
  }
  UniqueFd dir(open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dir.valid()) return errno;
  if (fsync(dir.get()) != 0 && errno != EINVAL) return errno;
  return 0;
}

int writeInPlace(const std::string& path, const plist::Data& bytes, bool noProtection) {
  UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644));
  if (!fd.valid()) return errno;
  if (int err = writeAll(fd.get(), bytes)) return err;
  if (noProtection && fremovexattr(fd.get(), kProtectionClassAttribute) != 0 && errno != ENODATA &&
      errno != EOPNOTSUPP)
    return errno;
  if (close(fd.release()) != 0) return errno;
  return 0;
}

// Reads a regular file whole; a FIFO or a link put in place of one of our
// files is refused rather than waited on or followed.
int readSmallFile(const char* path, plist::Data* out) {
  UniqueFd fd(open(path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!fd.valid()) return errno;
  struct stat st;
  if (fstat(fd.get(), &st) != 0) return errno;
  if (S_ISDIR(st.st_mode)) return EISDIR;
  if (!S_ISREG(st.st_mode)) return EINVAL;
  if (st.st_size > kMaxPropertyListFileSize) return EFBIG;
  out->resize(static_cast<size_t>(st.st_size));
  size_t done = 0;
  while (done < out->size()) {
    ssize_t n = read(fd.get(), out->data() + done, out->size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return errno;
    if (n == 0) break;
    done += static_cast<size_t>(n);
  }
  out->resize(done);
  return 0;
}

int lstatError(const QRTURL& url) {
  struct stat st;
  return lstat(url.fileSystemRepresentation(), &st) == 0 ? 0 : errno;
}

QRTTraversalEntry::Kind kindOfFtsEntry(int info) {
  switch (info) {
    case FTS_D:
      return QRTTraversalEntry::Kind::DirectoryPre;
    case FTS_DP:
      return QRTTraversalEntry::Kind::DirectoryPost;
    case FTS_F:
      return QRTTraversalEntry::Kind::File;
    case FTS_SL:
    case FTS_SLNONE:
      return QRTTraversalEntry::Kind::Symlink;
    default:
      return QRTTraversalEntry::Kind::Other;
  }
}

}  // namespace

// ---------------------------------------------------------------------------

QRTFileManager& QRTFileManager::defaultManager() {
  static QRTFileManager manager;
  return manager;
}

bool QRTFileManager::removeItemAtURL(const QRTURL& url, QRTErrorRef* error) {
  if (url.empty()) {
    QRTSetError(error, QRT_POSIX_ERROR(EFAULT, "nil url passed to -removeItemAtURL:error:"));
    return false;
  }
  TreePruner pruner(url.fileSystemRepresentation());
  int err = pruner.run();
  if (err == 0 || err == ENOENT) err = pruner.firstError();
  if (err != 0 && err != ENOENT) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "prunetree of %@ failed: %s", url, errorText(err)));
    return false;
  }
  return true;
}

bool QRTFileManager::createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode,
                                          uint32_t owner, int32_t protectionClass, QRTErrorRef* error) {
  const char* path = url.fileSystemRepresentation();
  if (withIntermediateDirectories) {
    int err = ensureDirectories(url.path(), mode);
    if (err != 0 && err != EEXIST) {
      QRTSetError(error, QRT_POSIX_ERROR(err, "ensuredirs of %s failed: %s", path, errorText(err)));
      return false;
    }
  } else if (mkdir(path, mode) != 0 && errno != EEXIST) {
    int err = errno;
    QRTSetError(error, QRT_POSIX_ERROR(err, "mkdir of %s failed: %s", path, errorText(err)));
    return false;
  }
  if (protectionClass != -1) {
    UniqueFd fd(open(path, O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!fd.valid()) {
      int err = errno;
      QRTSetError(error, QRT_POSIX_ERROR(err, "opendir of %s failed: %s", path, errorText(err)));
      return false;
    }
    if (int err = QRTSetProtectionClass(fd.get(), protectionClass)) {
      QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to setclass(%d) on directory %s: %s", protectionClass, path,
                                         errorText(err)));
      return false;
    }
  }
  if (owner != 0 && chown(path, owner, owner) != 0) {
    // Ignored: the directory is there and usable; callers that care check the owner.
  }
  return true;
}

bool QRTFileManager::createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode,
                                          uint32_t owner, QRTErrorRef* error) {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, owner, -1, error);
}

bool QRTFileManager::createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode,
                                          int32_t protectionClass, QRTErrorRef* error) {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0u, protectionClass, error);
}

bool QRTFileManager::createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode,
                                          QRTErrorRef* error) {
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0u, -1, error);
}


// Reports a failed look at a copy or move source; always false.
static bool statFailed(const char* function, const QRTURL& src, int err, QRTErrorRef* error) {
  QRTSetError(error, QRTCreatePOSIXError(function, __LINE__, err, "stat of %@ failed: %s", src, errorText(err)));
  return false;
}

bool QRTFileManager::_copyItemAtURL(const QRTURL& src, const QRTURL& toURL, bool failIfSrcMissing,
                                    QRTErrorRef* error) {
  if (!failIfSrcMissing) {
    if (int err = lstatError(src)) return err == ENOENT || statFailed(__func__, src, err, error);
  }
  TreeCloner cloner;
  if (int err = cloner.run(src.fileSystemRepresentation(), toURL.fileSystemRepresentation())) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "clonetree of %@ to %@ failed: %s", src, toURL, errorText(err)));
    return false;
  }
  return true;
}

bool QRTFileManager::copyItemAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  return _copyItemAtURL(src, toURL, true, error);
}

bool QRTFileManager::copyItemIfExistsAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  return _copyItemAtURL(src, toURL, false, error);
}

bool QRTFileManager::_moveItemAtURL(const QRTURL& src, const QRTURL& toURL, bool failIfSrcMissing,
                                    QRTErrorRef* error) {
  if (!failIfSrcMissing) {
    if (int err = lstatError(src)) return err == ENOENT || statFailed(__func__, src, err, error);
  }
  if (rename(src.fileSystemRepresentation(), toURL.fileSystemRepresentation()) == 0) return true;
  int err = errno;
  if (err != EXDEV) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "rename of %@ to %@ failed: %s", src, toURL, errorText(err)));
    return false;
  }
  if (!_copyItemAtURL(src, toURL, true, error)) return false;
  QRTErrorRef removeError;
  if (!removeItemAtURL(src, &removeError)) {
    QRTLog(kLogError, "Failed to remove source %@ : %s", src, errorText(removeError ? removeError->code() : 0));
  }
  return true;
}

bool QRTFileManager::moveItemAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  return _moveItemAtURL(src, toURL, true, error);
}

bool QRTFileManager::moveItemIfExistsAtURL(const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  return _moveItemAtURL(src, toURL, false, error);
}

std::optional<QRTURL> QRTFileManager::createTemporaryDirectoryInDirectoryURL(const QRTURL& parent,
                                                                             std::string_view withNamePrefix,
                                                                             QRTErrorRef* error) {
  if (error) *error = nullptr;
  std::string name(withNamePrefix);
  name += "XXXXXX";
  std::string path = parent.URLByAppendingPathComponent(name, true).path();
  if (!mkdtemp(path.data())) {
    int err = errno;
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to create temp dir at path %s : %s", path, errorText(err)));
    return std::nullopt;
  }
  return QRTURL::fileURL(path, true);
}

std::optional<QRTURL> QRTFileManager::createTemporaryDirectoryInDirectoryURL(const QRTURL& parent,
                                                                             QRTErrorRef* error) {
  return createTemporaryDirectoryInDirectoryURL(parent, "temp.", error);
}

bool QRTFileManager::_traverseDirectory(const QRTURL& root, QRTErrorRef* error,
                                        const QRTTraversalVisitor& withBlock) {
  const char* path = root.fileSystemRepresentation();
  char* roots[] = {const_cast<char*>(path), nullptr};
  struct FtsCloser {
    void operator()(FTS* fts) const { fts_close(fts); }
  };
  std::unique_ptr<FTS, FtsCloser> fts(fts_open(roots, FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV, nullptr));
  if (!fts) {
    int err = errno;
    QRTSetError(error, QRT_POSIX_ERROR(err, "fts_open failed for %s with error %s", path, errorText(err)));
    return false;
  }
  bool stopped = false;
  QRTErrorRef walkError;
  for (;;) {
    errno = 0;
    FTSENT* ent = fts_read(fts.get());
    if (!ent) {
      if (errno != 0) {
        stopped = true;
        walkError = QRT_POSIX_ERROR(errno, "Error for path %s: %s", path, errorText(errno));
      }
      break;
    }
    if (ent->fts_info == FTS_ERR || ent->fts_info == FTS_NS) {
      stopped = true;
      walkError = QRT_POSIX_ERROR(ent->fts_errno, "Error for path %s: %s", path, errorText(ent->fts_errno));
      break;
    }
    QRTTraversalEntry entry;
    QRTErrorRef visitorError;
    entry.path = ent->fts_path;
    entry.level = ent->fts_level;
    entry.kind = kindOfFtsEntry(ent->fts_info);
    if (ent->fts_statp) entry.st = *ent->fts_statp;
    entry.error = ent->fts_info == FTS_DNR ? ent->fts_errno : 0;
    if (!withBlock(entry, &visitorError)) {
      stopped = true;
      walkError = std::move(visitorError);
      break;
    }
    if (entry.skipDescendants && ent->fts_info == FTS_D) fts_set(fts.get(), ent, FTS_SKIP);
  }
  if (fts_close(fts.release()) != 0 && !walkError) {
    int err = errno;
    stopped = true;
    walkError = QRT_POSIX_ERROR(err, "fts_close failed for %s with error %s", path, errorText(err));
  }
  if (stopped && walkError) QRTSetError(error, walkError);
  return !stopped;
}

namespace {

// Calls visit(name, isDirectory) for every visible entry of the directory.
template <typename Visit>
bool iterateDirectory(const QRTURL& url, QRTErrorRef* error, Visit visit) {
  const char* path = url.fileSystemRepresentation();
  UniqueDir dir(opendir(path));
  if (!dir) {
    int err = errno;
    if (err != ENOENT) QRTLogAs(kLogError, "_IterateDirectory", "opendir of %s failed: %s", path, errorText(err));
    QRTSetError(error, QRT_POSIX_ERROR(err, "_IterateDirectory for %@ returned %s", url, errorText(err)));
    return false;
  }
  for (;;) {
    errno = 0;
    struct dirent* entry = readdir(dir.get());
    if (!entry) break;
    if (entry->d_name[0] == '.') continue;
    unsigned char type = entry->d_type;
    if (type == DT_UNKNOWN) {
      struct stat st;
      std::string child = std::string(path) + "/" + entry->d_name;
      if (stat(child.c_str(), &st) == 0) type = typeOfMode(st.st_mode);
    }
    visit(entry->d_name, type == DT_DIR);
  }
  if (errno != 0) {
    int err = errno;
    QRTSetError(error, QRT_POSIX_ERROR(err, "_IterateDirectory for %@ returned %s", url, errorText(err)));
    return false;
  }
  return true;
}

}  // namespace

std::optional<std::vector<QRTURL>> QRTFileManager::urlsForItemsInDirectoryAtURL(const QRTURL& url,
                                                                                QRTErrorRef* error) {
  std::vector<QRTURL> urls;
  bool ok = iterateDirectory(url, error, [&](const char* name, bool isDirectory) {
    urls.push_back(url.URLByAppendingPathComponent(name, isDirectory));
  });
  if (!ok) return std::nullopt;
  return urls;
}

bool QRTFileManager::itemExistsAtURL(const QRTURL& url) {
  struct stat st;
  if (lstat(url.fileSystemRepresentation(), &st) == 0) return true;
  int err = errno;
  if (err != ENOENT) QRTLog(kLogError, "Failed to determine if %@ exists: %s", url, errorText(err));
  return false;
}

bool QRTFileManager::itemDoesNotExistAtURL(const QRTURL& url) {
  struct stat st;
  if (lstat(url.fileSystemRepresentation(), &st) == 0) return false;
  int err = errno;
  if (err == ENOENT) return true;
  QRTLog(kLogError, "Failed to determine if %@ exists: %s", url, errorText(err));
  return false;
}

// ---------------------------------------------------------------------------

bool QRT_writeToURL(const plist::Dictionary& dictionary, const QRTURL& url, QRTWriteOptions withOptions,
                    QRTErrorRef* error) {
  plist::Data bytes;
  int err = 0;
  try {
    bytes = plist::writeBinary(plist::Value(dictionary));
  } catch (const std::bad_alloc&) {
    err = ENOMEM;
  }
  if (!err) {
    err = (withOptions & QRTWriteAtomic)
              ? writeAtomically(url.path(), bytes)
              : writeInPlace(url.path(), bytes, (withOptions & QRTWriteFileProtectionNone) != 0);
  }
  if (err) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to write property list to %@: %s", url, errorText(err)));
    return false;
  }
  return true;
}

std::optional<plist::Dictionary> QRT_dictionaryWithContentsOfURL(const QRTURL& url, QRTErrorRef* error) {
  plist::Data bytes;
  if (int err = readSmallFile(url.fileSystemRepresentation(), &bytes)) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to read property list at %@: %s", url, errorText(err)));
    return std::nullopt;
  }
  std::string reason;
  std::optional<plist::Value> value = plist::parse(bytes.data(), bytes.size(), &reason);
  if (!value) {
    QRTSetError(error, QRTCreateError(__func__, __LINE__, QRTPropertyListErrorDomain, QRTPropertyListReadCorruptError,
                                      nullptr, nullptr, false, "Failed to parse property list at %@: %s", url,
                                      reason.c_str()));
    return std::nullopt;
  }
  if (!value->isDictionary()) {
    QRTSetError(error, QRTCreateError(__func__, __LINE__, QRTPropertyListErrorDomain, QRTFormattingError, nullptr, nullptr,
                                      false, "Property list at %@ is not a dictionary", url));
    return std::nullopt;
  }
  return std::move(value->dictionary());
}

bool containsDotDotPathComponents(std::string_view path) {
  while (!path.empty()) {
    size_t slash = path.find('/');
    if (path.substr(0, slash) == "..") return true;
    if (slash == std::string_view::npos) break;
    path.remove_prefix(slash + 1);
  }
  return false;
}

std::string stringWithFileSystemRepresentation(const char* bytes, size_t length) {
  return bytes ? std::string(bytes, length) : std::string();
}

std::string stringWithFileSystemRepresentation(const char* bytes) {
  return bytes ? std::string(bytes) : std::string();
}

// ---------------------------------------------------------------------------

int QRTGetProtectionClass(int fd, int32_t* cls) {
  if (!cls) return EFAULT;
  uint8_t b[4];
  ssize_t n = fgetxattr(fd, kProtectionClassAttribute, b, sizeof b);
  if (n < 0) {
    if (errno != ENODATA) return errno;
    *cls = 0;
    return 0;
  }
  if (n != sizeof b) return EINVAL;
  *cls = static_cast<int32_t>(static_cast<uint32_t>(b[0]) | static_cast<uint32_t>(b[1]) << 8 |
                              static_cast<uint32_t>(b[2]) << 16 | static_cast<uint32_t>(b[3]) << 24);
  return 0;
}

int QRTSetProtectionClass(int fd, int32_t cls) {
  if (platform::deviceLockState() == 1) {
    if (cls == 1) return EPERM;
    int32_t current = 0;
    if (int err = QRTGetProtectionClass(fd, &current)) return err;
    if (current == 1) return EPERM;
  }
  const uint32_t v = static_cast<uint32_t>(cls);
  const uint8_t b[4] = {static_cast<uint8_t>(v), static_cast<uint8_t>(v >> 8), static_cast<uint8_t>(v >> 16),
                        static_cast<uint8_t>(v >> 24)};
  if (fsetxattr(fd, kProtectionClassAttribute, b, sizeof b, 0) != 0) return errno;
  return 0;
}
