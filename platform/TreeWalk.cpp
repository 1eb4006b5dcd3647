#include "platform/TreeWalk.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/FileIO.h"
#include "platform/SafePath.h"

namespace platform {

namespace {

using Kind = TreeEntry::Kind;

Kind kindOfMode(mode_t mode) {
  if (S_ISDIR(mode)) return Kind::DirectoryPre;
  if (S_ISREG(mode)) return Kind::File;
  if (S_ISLNK(mode)) return Kind::Symlink;
  return Kind::Other;
}

class Walk {
 public:
  Walk(const TreeVisitor& visitor, const TreeWalkOptions& options) : visitor_(visitor), options_(options) {}
  int run(std::string_view hostPath);
  int runAt(int parentFd, const char* name);
  void setPath(std::string_view path) { path_ = path; }

 private:
  struct Frame {
    UniqueFd fd;
    struct stat st;
    std::string name;
    size_t parentPathLength;
    std::vector<TreeListedEntry> children;
    size_t next = 0;
  };

  bool visit(Kind kind, int parentFd, const char* name, const struct stat& st, int level, int error = 0,
             bool* skip = nullptr, int fd = -1);
  bool visitChild(const std::string& name, unsigned char type);
  bool enter(int parentFd, const std::string& name, struct stat st, bool statKnown = true);
  bool leave();
  int parentFdOfTop();
  int readChildren(Frame& frame, size_t* malformed);
  bool fail(int err) {
    result_ = err;
    return false;
  }

  const TreeVisitor& visitor_;
  const TreeWalkOptions& options_;
  SafeParent rootParent_;
  int rootParentFd_ = -1;
  std::string path_;
  std::vector<Frame> stack_;
  std::unique_ptr<DirectoryBatch> batch_;
  dev_t device_ = 0;
  int result_ = 0;
};

int Walk::run(std::string_view hostPath) {
  path_ = hostPath;
  int err = safeOpenParent(path_, &rootParent_);
  if (err) return err;
  return runAt(rootParent_.fd.get(), rootParent_.name.c_str());
}

int Walk::runAt(int parentFd, const char* name) {
  rootParentFd_ = parentFd;
  struct stat st;
  bool ok = fstatat(parentFd, name, &st, AT_SYMLINK_NOFOLLOW) != 0 ? fail(errno) : true;
  if (ok) {
    device_ = st.st_dev;
    ok = S_ISDIR(st.st_mode) ? enter(parentFd, name, st) : visit(kindOfMode(st.st_mode), parentFd, name, st, 0);
  }
  while (ok && !stack_.empty()) {
    Frame& top = stack_.back();
    if (top.next < top.children.size()) {
      TreeListedEntry child = std::move(top.children[top.next++]);
      ok = visitChild(child.name, child.type);
    } else {
      ok = leave();
    }
  }
  return ok ? 0 : result_;
}

mode_t modeOfType(unsigned char type) {
  switch (type) {
    case DT_DIR: return S_IFDIR;
    case DT_REG: return S_IFREG;
    case DT_LNK: return S_IFLNK;
    case DT_FIFO: return S_IFIFO;
    case DT_SOCK: return S_IFSOCK;
    case DT_CHR: return S_IFCHR;
    case DT_BLK: return S_IFBLK;
    default: return 0;
  }
}

bool Walk::visit(Kind kind, int parentFd, const char* name, const struct stat& st, int level, int error, bool* skip,
                 int fd) {
  TreeEntry entry;
  entry.path = path_.c_str();
  entry.level = level;
  entry.kind = kind;
  entry.st = st;
  entry.error = error;
  entry.parentFd = parentFd;
  entry.name = name;
  entry.fd = fd;
  if (!visitor_(entry)) return fail(kTreeWalkStopped);
  if (skip) *skip = entry.skipDescendants;
  return true;
}

bool Walk::visitChild(const std::string& name, unsigned char type) {
  const int parentFd = stack_.back().fd.get();
  const size_t parentLength = path_.size();
  struct stat st {};
  const bool statKnown = !options_.typesFromListing || type == DT_UNKNOWN;
  if (!statKnown) {
    st.st_mode = modeOfType(type);
  } else if (fstatat(parentFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
    if (errno == ENOENT) return true;  // gone meanwhile
    return fail(errno);
  }
  bool ok;
  if (S_ISDIR(st.st_mode)) {
    ok = enter(parentFd, name, st, statKnown);
  } else {
    path_ += '/';
    path_ += name;
    ok = visit(kindOfMode(st.st_mode), parentFd, name.c_str(), st, static_cast<int>(stack_.size()));
    path_.resize(parentLength);
  }
  return ok;
}

// Visits the directory, then pushes it unless it is to be passed over. Known
// only by its listed type, it is taken as what the open finds.
bool Walk::enter(int parentFd, const std::string& name, struct stat st, bool statKnown) {
  const size_t parentLength = path_.size();
  const int level = static_cast<int>(stack_.size());
  if (level > 0) {
    path_ += '/';
    path_ += name;
  }
  UniqueFd fd;
  int err = 0;
  if (!options_.sameFileSystem || !statKnown || st.st_dev == device_) {
    fd.reset(openDirectoryAt(parentFd, name.c_str()));
    struct stat opened;
    if (!fd.valid())
      err = errno;
    else if (fstat(fd.get(), &opened) != 0)
      err = errno;
    else if (!statKnown)
      st = opened;
    else if (opened.st_dev != st.st_dev || opened.st_ino != st.st_ino)
      err = ESTALE;
    if (!err && options_.sameFileSystem && st.st_dev != device_) fd.reset();
  }
  if (err) {
    // Unreadable, or swapped since the listing: reported, not entered.
    bool ok = visit(Kind::Other, parentFd, name.c_str(), st, level, err);
    path_.resize(parentLength);
    return ok;
  }
  bool skip = false;
  if (!visit(Kind::DirectoryPre, parentFd, name.c_str(), st, level, 0, &skip, fd.get())) return false;
  Frame frame{std::move(fd), st, name, parentLength, {}, 0};
  // Another file system's directory is seen, never entered.
  if (!skip && frame.fd.valid()) {
    size_t malformed = 0;
    int readErr = readChildren(frame, &malformed);
    if (options_.onListing) {
      TreeListing listing;
      listing.path = path_.c_str();
      listing.level = level;
      listing.fd = frame.fd.get();
      listing.error = readErr;
      listing.malformed = malformed;
      listing.entries = &frame.children;
      if (!options_.onListing(listing)) return fail(kTreeWalkStopped);
    } else if (readErr) {
      return fail(readErr);
    }
  }
  const size_t limit = options_.maxOpenDirectories > 0 ? options_.maxOpenDirectories : 1;
  if (stack_.size() >= limit) stack_[stack_.size() - limit].fd.reset();
  stack_.push_back(std::move(frame));
  return true;
}

int Walk::readChildren(Frame& frame, size_t* malformed) {
  if (!batch_) batch_ = std::make_unique<DirectoryBatch>();
  for (;;) {
    ssize_t n = readDirectoryBatch(frame.fd.get(), batch_.get());
    if (n < 0) return static_cast<int>(-n);
    if (n == 0) return 0;
    forEachEntry(*batch_, static_cast<size_t>(n), [&](uint64_t inode, unsigned char type, const char* name) {
      if (name)
        frame.children.push_back({name, type, inode});
      else
        ++*malformed;
    });
  }
}

// The descriptor of the directory below the top, reopened through the top's
// ".." when it was closed for depth, and only if it is still the one we came
// from.
int Walk::parentFdOfTop() {
  if (stack_.size() < 2) return rootParentFd_;
  Frame& parent = stack_[stack_.size() - 2];
  if (!parent.fd.valid()) {
    const Frame& child = stack_.back();
    if (!child.fd.valid()) return -1;
    UniqueFd fd(openDirectoryAt(child.fd.get(), ".."));
    struct stat st;
    if (!fd.valid() || fstat(fd.get(), &st) != 0) return -1;
    if (st.st_dev != parent.st.st_dev || st.st_ino != parent.st.st_ino) {
      errno = ESTALE;
      return -1;
    }
    parent.fd = std::move(fd);
  }
  return parent.fd.get();
}

bool Walk::leave() {
  int parentFd = parentFdOfTop();
  if (parentFd < 0) return fail(errno);
  Frame& top = stack_.back();
  const int level = static_cast<int>(stack_.size()) - 1;
  bool ok = visit(Kind::DirectoryPost, parentFd, top.name.c_str(), top.st, level, 0, nullptr, top.fd.get());
  path_.resize(top.parentPathLength);
  stack_.pop_back();
  return ok;
}

}  // namespace

int walkTree(std::string_view hostPath, const TreeVisitor& visitor, const TreeWalkOptions& options) {
  return Walk(visitor, options).run(hostPath);
}

int walkTreeAt(int parentFd, const char* name, std::string_view path, const TreeVisitor& visitor,
               const TreeWalkOptions& options) {
  Walk walk(visitor, options);
  walk.setPath(path);
  return walk.runAt(parentFd, name);
}

}  // namespace platform
