#include "platform/TreeWalk.h"

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

 private:
  struct Frame {
    UniqueFd fd;
    struct stat st;
    std::string name;
    size_t parentPathLength;
    std::vector<std::string> children;
    size_t next = 0;
  };

  bool visit(Kind kind, int parentFd, const char* name, const struct stat& st, int level, int error = 0,
             bool* skip = nullptr);
  bool visitChild(const std::string& name);
  bool enter(int parentFd, const std::string& name, const struct stat& st);
  bool leave();
  int parentFdOfTop();
  int readChildren(Frame& frame);
  bool fail(int err) {
    result_ = err;
    return false;
  }

  const TreeVisitor& visitor_;
  const TreeWalkOptions& options_;
  SafeParent rootParent_;
  std::string path_;
  std::vector<Frame> stack_;
  std::unique_ptr<DirectoryBatch> batch_;
  dev_t device_ = 0;
  int result_ = 0;
};

int Walk::run(std::string_view hostPath) {
  path_ = hostPath;
  struct stat st;
  int err = safeOpenParent(path_, &rootParent_);
  if (!err && fstatat(rootParent_.fd.get(), rootParent_.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) err = errno;
  bool ok = err ? fail(err) : true;
  if (ok) {
    device_ = st.st_dev;
    const int parentFd = rootParent_.fd.get();
    ok = S_ISDIR(st.st_mode) ? enter(parentFd, rootParent_.name, st)
                             : visit(kindOfMode(st.st_mode), parentFd, rootParent_.name.c_str(), st, 0);
  }
  while (ok && !stack_.empty()) {
    Frame& top = stack_.back();
    if (top.next < top.children.size()) {
      std::string name = std::move(top.children[top.next++]);
      ok = visitChild(name);
    } else {
      ok = leave();
    }
  }
  return ok ? 0 : result_;
}

bool Walk::visit(Kind kind, int parentFd, const char* name, const struct stat& st, int level, int error, bool* skip) {
  TreeEntry entry;
  entry.path = path_.c_str();
  entry.level = level;
  entry.kind = kind;
  entry.st = st;
  entry.error = error;
  entry.parentFd = parentFd;
  entry.name = name;
  if (!visitor_(entry)) return fail(kTreeWalkStopped);
  if (skip) *skip = entry.skipDescendants;
  return true;
}

bool Walk::visitChild(const std::string& name) {
  const int parentFd = stack_.back().fd.get();
  const size_t parentLength = path_.size();
  struct stat st;
  if (fstatat(parentFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
    if (errno == ENOENT) return true;  // gone meanwhile
    return fail(errno);
  }
  bool ok;
  if (S_ISDIR(st.st_mode)) {
    ok = enter(parentFd, name, st);
  } else {
    path_ += '/';
    path_ += name;
    ok = visit(kindOfMode(st.st_mode), parentFd, name.c_str(), st, static_cast<int>(stack_.size()));
    path_.resize(parentLength);
  }
  return ok;
}

// Visits the directory, then pushes it unless it is to be passed over.
bool Walk::enter(int parentFd, const std::string& name, const struct stat& st) {
  const size_t parentLength = path_.size();
  const int level = static_cast<int>(stack_.size());
  if (level > 0) {
    path_ += '/';
    path_ += name;
  }
  UniqueFd fd;
  int err = 0;
  if (!options_.sameFileSystem || st.st_dev == device_) {
    fd.reset(openDirectoryAt(parentFd, name.c_str()));
    struct stat opened;
    if (!fd.valid())
      err = errno;
    else if (fstat(fd.get(), &opened) != 0)
      err = errno;
    else if (opened.st_dev != st.st_dev || opened.st_ino != st.st_ino)
      err = ESTALE;
  }
  if (err) {
    // Unreadable, or swapped since the listing: reported, not entered.
    bool ok = visit(Kind::Other, parentFd, name.c_str(), st, level, err);
    path_.resize(parentLength);
    return ok;
  }
  bool skip = false;
  if (!visit(Kind::DirectoryPre, parentFd, name.c_str(), st, level, 0, &skip)) return false;
  Frame frame{std::move(fd), st, name, parentLength, {}, 0};
  // Another file system's directory is seen, never entered.
  if (!skip && frame.fd.valid()) {
    if (int readErr = readChildren(frame)) return fail(readErr);
  }
  const size_t limit = options_.maxOpenDirectories > 0 ? options_.maxOpenDirectories : 1;
  if (stack_.size() >= limit) stack_[stack_.size() - limit].fd.reset();
  stack_.push_back(std::move(frame));
  return true;
}

int Walk::readChildren(Frame& frame) {
  if (!batch_) batch_ = std::make_unique<DirectoryBatch>();
  for (;;) {
    ssize_t n = readDirectoryBatch(frame.fd.get(), batch_.get());
    if (n < 0) return static_cast<int>(-n);
    if (n == 0) return 0;
    forEachEntry(*batch_, static_cast<size_t>(n), [&](uint64_t, unsigned char, const char* name) {
      if (name) frame.children.emplace_back(name);
    });
  }
}

// The descriptor of the directory below the top, reopened through the top's
// ".." when it was closed for depth, and only if it is still the one we came
// from.
int Walk::parentFdOfTop() {
  if (stack_.size() < 2) return rootParent_.fd.get();
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
  bool ok = visit(Kind::DirectoryPost, parentFd, top.name.c_str(), top.st, level);
  path_.resize(top.parentPathLength);
  stack_.pop_back();
  return ok;
}

}  // namespace

int walkTree(std::string_view hostPath, const TreeVisitor& visitor, const TreeWalkOptions& options) {
  return Walk(visitor, options).run(hostPath);
}

}  // namespace platform
