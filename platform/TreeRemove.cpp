#include "platform/TreeRemove.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <memory>
#include <thread>
#include <utility>
#include <vector>

#include "base/QRTFormat.h"
#include "platform/FileIO.h"
#include "platform/Log.h"

namespace platform {

namespace {

constexpr size_t kParallelUnlinkThreshold = 64;
constexpr unsigned kUnlinkThreads = 4;
// Deeper trees than this are walked with only this many directories open;
// the rest are reopened through ".." on the way back up.
constexpr size_t kMaxOpenDirectories = 64;

// Removes a tree depth first without following links or leaving the root's
// device. Entries that cannot be removed are reported to entryFailed and the
// walk goes on; the first such errno is kept. The files of a large directory
// are unlinked by a few threads at once.
class TreePruner {
 public:
  // The item name in the directory parentFd; path names it in messages.
  TreePruner(int parentFd, std::string name, std::string path)
      : parentFd_(parentFd), rootName_(std::move(name)), path_(std::move(path)) {}
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

  int parentFd_;
  std::string rootName_;
  std::string path_;  // the path of the directory on top of the stack
  std::vector<Frame> stack_;
  std::unique_ptr<platform::DirectoryBatch> batch_;
  std::vector<Victim> victims_;  // scratch of scan()
  std::string names_;
  dev_t rootDevice_ = 0;
  std::atomic<int> firstError_{0};  // entryFailed runs on several threads
};

int TreePruner::run() {
  UniqueFd fd(openDirectoryAt(parentFd_, rootName_.c_str()));
  if (!fd.valid()) {
    int err = errno;
    if (err != ENOTDIR && err != ELOOP) return err;
    removeAt(parentFd_, rootName_.c_str(), 0, path_);  // a file or a link
    return 0;
  }
  struct stat st;
  if (fstat(fd.get(), &st) != 0) return errno;
  rootDevice_ = st.st_dev;
  batch_ = std::make_unique<platform::DirectoryBatch>();
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
    ssize_t n = platform::readDirectoryBatch(frame.fd.get(), batch_.get());
    if (n < 0) record(path_, static_cast<int>(-n));
    more = n > 0;
    if (!more) break;
    platform::forEachEntry(*batch_, static_cast<size_t>(n), [&](uint64_t inode, unsigned char type, const char* name) {
      if (!name) return;
      if (type == DT_DIR) {
        frame.subdirectories.emplace_back(name);
      } else {
        victims_.push_back({inode, names_.size()});
        names_.append(name, strlen(name) + 1);
      }
    });
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
        int err = platform::removeEntryAt(frame.fd.get(), name);
        if (err == 0) continue;
        if (err == EISDIR) {  // the file system gave no type
          directories[t].emplace_back(name);
        } else {
          entryFailed(frame.fd.get(), name, childPath(name), err);
        }
      }
    } catch (const std::exception&) { keepFirst(ENOMEM); }
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
    removeAt(parentFd_, rootName_.c_str(), AT_REMOVEDIR, path_);
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
  if (int err = platform::removeEntryAt(dirfd, name, flags)) entryFailed(dirfd, name, path, err);
}

// The per-entry error hook: an entry that is only in the way because of its
// immutable flag loses the flag and is unlinked; every other failure is
// logged and the first one kept.
void TreePruner::entryFailed(int dirfd, const char* name, const std::string& path, int err) {
  if (err == ENOENT) return;  // gone already
  QRTLog(kLogError, "prunetree hit error for %s : %s", path.c_str(), errorText(err));
  if (err == EPERM && unsetImmutable(dirfd, name, path)) {
    int unlinkErr = platform::removeEntryAt(dirfd, name);
    if (unlinkErr == 0) return;
    QRTLog(kLogError, "unlink of %s failed: %s", path.c_str(), errorText(unlinkErr));
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
  platform::Item item;
  if (int err = platform::openItemAt(dirfd, name, &item)) {
    QRTLog(kLogError, "Failed to stat %s before unsetting UF_IMMUTABLE: %s", path.c_str(), errorText(err));
    return false;
  }
  UniqueFd fd;
  if (platform::reopenItem(item, O_RDONLY, &fd) != 0) return false;
  bool immutable = false;
  if (int err = platform::immutableFlag(fd.get(), &immutable)) {
    if (err == ENOTTY || err == EOPNOTSUPP) return false;  // no flags on this file system
    QRTLog(kLogError, "Failed to stat %s before unsetting UF_IMMUTABLE: %s", path.c_str(), errorText(err));
    return false;
  }
  if (!immutable) return false;
  if (int err = platform::clearImmutableFlag(fd.get())) {
    QRTLog(kLogError, "Failed to lchflags %s: %s", path.c_str(), errorText(err));
    return false;
  }
  QRTLog(kLogNotice, "Unset UF_IMMUTABLE on %s", path.c_str());
  return true;
}

}  // namespace

int removeTree(int parentFd, const std::string& name, const std::string& path) {
  TreePruner pruner(parentFd, name, path);
  int err = pruner.run();
  if (err == 0 || err == ENOENT) err = pruner.firstError();
  return err;
}

}  // namespace platform
