#include "Daemon/fileops/QRTFileManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <condition_variable>
#include <cstddef>
#include <cstring>
#include <deque>
#include <exception>
#include <memory>
#include <mutex>
#include <string>
#include <system_error>
#include <thread>
#include <unordered_set>
#include <utility>
#include <vector>

#include "base/QRTFormat.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/SafePath.h"

using platform::kLogDebug;
using platform::kLogError;

namespace {

// A second thread costs about as much as this many entries; smaller trees
// are walked by the calling thread alone.
constexpr uint64_t kEntriesBeforeHelper = 256;

using platform::UniqueFd;

struct FileId {
  uint64_t device;
  uint64_t inode;
  bool operator==(const FileId&) const = default;
};
struct FileIdHash {
  size_t operator()(const FileId& id) const {
    return std::hash<uint64_t>()(id.inode * 0x9E3779B97F4A7C15ull ^ id.device);
  }
};

class DiskUsageWalk;

// Reads directories for one thread of a walk: their bytes go to its own
// total, their child directories to a list handed back to the walk.
class DirectoryReader {
 public:
  explicit DirectoryReader(DiskUsageWalk& walk) : walk_(walk) {}
  // relative: below the walk's root ("." for the root itself).
  void measureDirectory(const std::string& relative);
  std::vector<std::string>& children() { return children_; }
  uint64_t total() const { return total_; }
  uint64_t entriesSeen() const { return entriesSeen_; }

 private:
  void visitEntry(int dirfd, const std::string& relative, uint64_t index, unsigned char type, const char* name);
  void queueDirectory(const std::string& relative, uint64_t index, const char* name);
  void countFile(const platform::EntryAttributes& attributes, const std::string& relative, const char* name);
  std::string pathOf(const std::string& relative) const;

  DiskUsageWalk& walk_;
  std::unique_ptr<platform::DirectoryBatch> batch_ = std::make_unique<platform::DirectoryBatch>();
  std::vector<std::string> children_;
  uint64_t total_ = 0;
  uint64_t entriesSeen_ = 0;
};

// One measurement: breadth first over a queue of directories (relative to
// the walk's root, each opened beneath it without following a link or
// crossing a mount), so that depth costs no stack. The walk is bound by one system call per entry, not
// by the disk, so in a larger tree a second thread takes part once two
// directories wait.
class DiskUsageWalk {
 public:
  DiskUsageWalk(int rootFd, std::string rootPath) : rootFd_(rootFd), rootPath_(std::move(rootPath)) {
    queue_.push_back(".");
  }
  ~DiskUsageWalk() {
    if (helper_.joinable()) helper_.join();
  }
  // Rethrows what a thread of the walk threw.
  uint64_t run();
  // True the first time a multiply-linked file is offered.
  bool firstSighting(const FileId& id);
  int rootFd() const { return rootFd_; }
  const std::string& rootPath() const { return rootPath_; }

 private:
  void work(bool mayStartHelper);
  bool takeDirectory(std::string* path);
  // Queues the children; answers how many directories are waiting.
  size_t finishDirectory(std::vector<std::string>& children);
  void startHelper();

  const int rootFd_;
  const std::string rootPath_;
  bool helperConsidered_ = false;  // by the calling thread, once
  std::mutex mutex_;
  std::condition_variable changed_;
  std::deque<std::string> queue_;
  unsigned busy_ = 0;  // directories being read
  std::exception_ptr failure_;
  uint64_t total_ = 0;
  std::unordered_set<FileId, FileIdHash> seen_;
  std::thread helper_;
};

uint64_t DiskUsageWalk::run() {
  work(true);
  if (helper_.joinable()) helper_.join();
  if (failure_) std::rethrow_exception(failure_);
  return total_;
}

bool DiskUsageWalk::firstSighting(const FileId& id) {
  std::lock_guard<std::mutex> hold(mutex_);
  return seen_.insert(id).second;
}

void DiskUsageWalk::work(bool mayStartHelper) {
  try {
    DirectoryReader reader(*this);
    std::string path;
    while (takeDirectory(&path)) {
      reader.measureDirectory(path);
      size_t waiting = finishDirectory(reader.children());
      if (mayStartHelper && !helperConsidered_ && waiting >= 2 && reader.entriesSeen() >= kEntriesBeforeHelper) {
        helperConsidered_ = true;
        startHelper();
      }
    }
    std::lock_guard<std::mutex> hold(mutex_);
    total_ += reader.total();
  } catch (...) {
    // Only allocation throws here; every thread gives up.
    std::lock_guard<std::mutex> hold(mutex_);
    if (!failure_) failure_ = std::current_exception();
    changed_.notify_all();
  }
}

bool DiskUsageWalk::takeDirectory(std::string* path) {
  std::unique_lock<std::mutex> hold(mutex_);
  changed_.wait(hold, [this] { return failure_ || !queue_.empty() || busy_ == 0; });
  if (failure_ || queue_.empty()) return false;
  *path = std::move(queue_.front());
  queue_.pop_front();
  ++busy_;
  return true;
}

size_t DiskUsageWalk::finishDirectory(std::vector<std::string>& children) {
  std::lock_guard<std::mutex> hold(mutex_);
  for (std::string& child : children) queue_.push_back(std::move(child));
  children.clear();
  --busy_;
  changed_.notify_all();
  return queue_.size();
}

void DiskUsageWalk::startHelper() {
  if (std::thread::hardware_concurrency() < 2) return;
  try {
    helper_ = std::thread([this] { work(false); });
  } catch (const std::system_error&) {
    // No thread to be had: the calling thread does it all.
  }
}

std::string DirectoryReader::pathOf(const std::string& relative) const {
  return relative == "." ? walk_.rootPath() : walk_.rootPath() + "/" + relative;
}

void DirectoryReader::measureDirectory(const std::string& relative) {
  UniqueFd fd;
  if (int err = platform::openBeneath(walk_.rootFd(), relative.c_str(), O_RDONLY | O_DIRECTORY, &fd, true)) {
    QRTLogAs(kLogError, "diskUsageForURL", "Failed to open directory %@ : %s", pathOf(relative), errorText(err));
    return;
  }
  uint64_t index = 0;
  for (;;) {
    ssize_t length = platform::readDirectoryBatch(fd.get(), batch_.get());
    if (length < 0) {
      QRTLogAs(kLogError, "diskUsageForURL", "bulkdirread on entry %llu in %@ returned error %s",
               static_cast<unsigned long long>(index), pathOf(relative), errorText(static_cast<int>(-length)));
      return;
    }
    if (length == 0) return;
    platform::forEachEntry(*batch_, static_cast<size_t>(length), [&](uint64_t, unsigned char type, const char* name) {
      ++entriesSeen_;
      visitEntry(fd.get(), relative, index++, type, name);
    });
  }
}

void DirectoryReader::visitEntry(int dirfd, const std::string& relative, uint64_t index, unsigned char type,
                                 const char* name) {
  if (type == DT_DIR) {
    queueDirectory(relative, index, name);
    return;
  }
  platform::EntryAttributes attributes;
  int err = name ? platform::entryAttributesAt(dirfd, name, &attributes) : EINVAL;
  if (err) {
    QRTLogAs(kLogError, "diskUsageForURL", "Got error %s while processing entry %llu in %@", errorText(err),
             static_cast<unsigned long long>(index), pathOf(relative));
    return;
  }
  if (type == DT_UNKNOWN && attributes.hasType && S_ISDIR(attributes.mode)) {
    queueDirectory(relative, index, name);
    return;
  }
  countFile(attributes, relative, name);
}

void DirectoryReader::queueDirectory(const std::string& relative, uint64_t index, const char* name) {
  // Linux reports no entry count with a directory's entry, so an empty child
  // is opened and read like any other.
  if (!name) {
    QRTLogAs(kLogError, "diskUsageForURL",
             "Failed to get name for directory item %llu in %@; not counting its children",
             static_cast<unsigned long long>(index), pathOf(relative));
    return;
  }
  const size_t nameLength = strlen(name);
  const std::string& root = walk_.rootPath();
  const size_t pathLength = root.size() + (relative == "." ? 0 : 1 + relative.size()) + 1 + nameLength;
  if (pathLength >= PATH_MAX) {
    QRTLogAs(kLogError, "diskUsageForURL", "Failed to create path to child directory by appending \"%s\" to %@", name,
             pathOf(relative));
    return;
  }
  std::string child;
  if (relative != ".") {
    child.reserve(relative.size() + 1 + nameLength);
    child.append(relative);
    child.push_back('/');
  }
  child.append(name, nameLength);
  children_.push_back(std::move(child));
}

void DirectoryReader::countFile(const platform::EntryAttributes& attributes, const std::string& relative,
                                const char* name) {
  if (attributes.links != 1) {
    if (!walk_.firstSighting({attributes.device, attributes.inode})) {
      QRTLogAs(kLogDebug, "diskUsageForURL", "Skipping hardlinked file at %@/%s", pathOf(relative), name);
      return;
    }
  }
  total_ += attributes.allocated;
}

}  // namespace

uint64_t QRTFileManager::diskUsageForURL(const QRTURL& url) {
  if (url.empty()) {
    QRTLog(kLogError, "Failed to get path to url %@", url);
    return 0;
  }
  // The root is resolved safely from the device root; the walk below it
  // stays on the root's file system.
  UniqueFd root;
  if (int err = platform::safeOpen(url.path(), O_PATH | O_DIRECTORY, &root)) {
    QRTLog(kLogError, "Failed to open directory %@ : %s", url.path(), errorText(err));
    return 0;
  }
  std::string rootPath = url.path();
  while (rootPath.size() > 1 && rootPath.back() == '/') rootPath.pop_back();
  try {
    return DiskUsageWalk(root.get(), std::move(rootPath)).run();
  } catch (...) {
    QRT_EXCEPTION_ERROR();  // logs it; only allocation can throw here
    return 0;
  }
}

namespace {

// The item itself, pinned, never a link's target; a link is ELOOP.
bool openForClass(const char* function, const QRTURL& url, platform::Item* item, QRTErrorRef* error) {
  int err = platform::safeOpenItem(url.path(), item);
  if (!err && S_ISLNK(item->st.st_mode)) err = ELOOP;
  if (err) {
    QRTSetError(error, QRTCreatePOSIXError(function, __LINE__, err, "Failed to open %s : %s",
                                           url.fileSystemRepresentation(), errorText(err)));
    return false;
  }
  return true;
}

bool readClass(const char* function, const platform::Item& item, const QRTURL& url, int32_t* current,
               QRTErrorRef* error) {
  if (int err = platform::itemProtectionClass(item, current)) {
    QRTSetError(error, QRTCreatePOSIXError(function, __LINE__, err, "Failed to getclass of file %s: %s",
                                           url.fileSystemRepresentation(), errorText(err)));
    return false;
  }
  return true;
}

}  // namespace

bool QRTFileManager::dataProtectionClassOfItemAtURL(const QRTURL& url, int32_t* cls, QRTErrorRef* error) {
  platform::Item item;
  if (!openForClass(__func__, url, &item, error)) return false;
  int32_t current = 0;
  if (!readClass(__func__, item, url, &current, error)) return false;
  if (cls) *cls = current;
  return true;
}

// The class is read and set on the one pinned item, so the predicate judges
// what is then changed.
bool QRTFileManager::setDataProtectionClassOfItemAtURL(const QRTURL& url, int32_t toClass,
                                                       const std::function<bool(int32_t)>& ifPredicate,
                                                       QRTErrorRef* error) {
  platform::Item item;
  if (!openForClass(__func__, url, &item, error)) return false;
  if (ifPredicate) {
    int32_t current = 0;
    if (!readClass(__func__, item, url, &current, error)) return false;
    try {
      if (!ifPredicate(current)) return true;
    } catch (...) {
      QRTSetError(error, QRT_EXCEPTION_ERROR());
      return false;
    }
  }
  if (int err = platform::setItemProtectionClass(item, toClass)) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to setclass(%d) on file %s: %s", toClass,
                                       url.fileSystemRepresentation(), errorText(err)));
    return false;
  }
  return true;
}

void QRTFileManager::printDirectoryStructureAtURL(const QRTURL& url) {
  QRTErrorRef error;
  bool ok = _traverseDirectory(url, &error, [](QRTTraversalEntry& entry, QRTErrorRef*) {
    if (entry.kind == QRTTraversalEntry::Kind::DirectoryPost) return true;
    if (entry.error != 0)
      QRTLogAs(kLogError, "printDirectoryStructureAtURL", "FTS returned error for %s : %s", entry.path,
               errorText(entry.error));
    else
      QRTLogAs(kLogError, "printDirectoryStructureAtURL", "\tOrphaned File: %s", entry.path);
    return true;
  });
  if (!ok && error)
    QRTLog(kLogError, "FTS returned error for %s : %s", url.fileSystemRepresentation(),
           errorText(static_cast<int>(error->code())));
}
