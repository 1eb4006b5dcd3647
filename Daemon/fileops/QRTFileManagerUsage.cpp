#include "Daemon/fileops/QRTFileManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <fts.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
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

#include "platform/Log.h"

using platform::kLogDebug;
using platform::kLogError;

namespace {

constexpr size_t kBulkReadSize = 32768;
constexpr unsigned kEntryAttributes = STATX_TYPE | STATX_BLOCKS | STATX_NLINK | STATX_INO;
// A second thread costs about as much as this many entries; smaller trees
// are walked by the calling thread alone.
constexpr uint64_t kEntriesBeforeHelper = 256;

const char* errorText(int err) { return strerror(err); }

class ScopedFd {
 public:
  explicit ScopedFd(int fd) : fd_(fd) {}
  ScopedFd(const ScopedFd&) = delete;
  ScopedFd& operator=(const ScopedFd&) = delete;
  ~ScopedFd() {
    if (fd_ >= 0) close(fd_);
  }
  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }

 private:
  int fd_;
};

// The record getdents64 fills in; glibc's struct dirent may differ in layout.
struct KernelDirent {
  uint64_t d_ino;
  int64_t d_off;
  unsigned short d_reclen;
  unsigned char d_type;
  char d_name[1];
};
constexpr size_t kDirentHeaderSize = offsetof(KernelDirent, d_name);

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
  void measureDirectory(const std::string& path);
  std::vector<std::string>& children() { return children_; }
  uint64_t total() const { return total_; }
  uint64_t entriesSeen() const { return entriesSeen_; }

 private:
  void visitBatch(int dirfd, const std::string& path, size_t length, uint64_t& index);
  void visitEntry(int dirfd, const std::string& path, uint64_t index, unsigned char type, const char* name);
  void queueDirectory(const std::string& path, uint64_t index, const char* name);
  void countFile(const struct statx& attributes, const std::string& path, const char* name);

  DiskUsageWalk& walk_;
  std::unique_ptr<uint64_t[]> buffer_{new uint64_t[kBulkReadSize / sizeof(uint64_t)]};
  std::vector<std::string> children_;
  uint64_t total_ = 0;
  uint64_t entriesSeen_ = 0;
};

// One measurement: breadth first over a queue of directory paths, so that
// depth costs no stack. The walk is bound by one system call per entry, not
// by the disk, so in a larger tree a second thread takes part once two
// directories wait.
class DiskUsageWalk {
 public:
  explicit DiskUsageWalk(std::string root) { queue_.push_back(std::move(root)); }
  ~DiskUsageWalk() {
    if (helper_.joinable()) helper_.join();
  }
  // Rethrows what a thread of the walk threw.
  uint64_t run();
  // True the first time a multiply-linked file is offered.
  bool firstSighting(const FileId& id);

 private:
  void work(bool mayStartHelper);
  bool takeDirectory(std::string* path);
  // Queues the children; answers how many directories are waiting.
  size_t finishDirectory(std::vector<std::string>& children);
  void startHelper();

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

void DirectoryReader::measureDirectory(const std::string& path) {
  ScopedFd fd(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd.valid()) {
    QRTLogAs(kLogError, "diskUsageForURL", "Failed to open directory %@ : %s", path, errorText(errno));
    return;
  }
  uint64_t index = 0;
  for (;;) {
    ssize_t length = getdents64(fd.get(), buffer_.get(), kBulkReadSize);
    if (length < 0 && errno == EINTR) continue;
    if (length < 0) {
      QRTLogAs(kLogError, "diskUsageForURL", "bulkdirread on entry %llu in %@ returned error %s",
               static_cast<unsigned long long>(index), path, errorText(errno));
      return;
    }
    if (length == 0) return;
    visitBatch(fd.get(), path, static_cast<size_t>(length), index);
  }
}

void DirectoryReader::visitBatch(int dirfd, const std::string& path, size_t length, uint64_t& index) {
  const char* bytes = reinterpret_cast<const char*>(buffer_.get());
  for (size_t offset = 0; offset + kDirentHeaderSize <= length;) {
    const auto* entry = reinterpret_cast<const KernelDirent*>(bytes + offset);
    const size_t recordLength = entry->d_reclen;
    if (recordLength <= kDirentHeaderSize || recordLength > length - offset) return;
    offset += recordLength;
    const char* name = entry->d_name;
    const size_t nameRoom = recordLength - kDirentHeaderSize;
    const size_t nameLength = strnlen(name, nameRoom);
    if (name[0] == '.' && (nameLength == 1 || (nameLength == 2 && name[1] == '.'))) continue;
    ++entriesSeen_;
    // A name that fills its record unterminated is no name at all.
    visitEntry(dirfd, path, index++, entry->d_type, nameLength < nameRoom && nameLength > 0 ? name : nullptr);
  }
}

void DirectoryReader::visitEntry(int dirfd, const std::string& path, uint64_t index, unsigned char type,
                                 const char* name) {
  if (type == DT_DIR) {
    queueDirectory(path, index, name);
    return;
  }
  struct statx attributes {};
  int err = name ? 0 : EINVAL;
  if (!err && statx(dirfd, name, AT_SYMLINK_NOFOLLOW | AT_STATX_DONT_SYNC, kEntryAttributes, &attributes) != 0) {
    err = errno;
  }
  if (err) {
    QRTLogAs(kLogError, "diskUsageForURL", "Got error %s while processing entry %llu in %@", errorText(err),
             static_cast<unsigned long long>(index), path);
    return;
  }
  if (type == DT_UNKNOWN && (attributes.stx_mask & STATX_TYPE) && S_ISDIR(attributes.stx_mode)) {
    queueDirectory(path, index, name);
    return;
  }
  countFile(attributes, path, name);
}

void DirectoryReader::queueDirectory(const std::string& path, uint64_t index, const char* name) {
  // Linux reports no entry count with a directory's entry, so an empty child
  // is opened and read like any other.
  if (!name) {
    QRTLogAs(kLogError, "diskUsageForURL",
             "Failed to get name for directory item %llu in %@; not counting its children",
             static_cast<unsigned long long>(index), path);
    return;
  }
  const size_t nameLength = strlen(name);
  const bool needsSeparator = path.empty() || path.back() != '/';
  if (path.size() + needsSeparator + nameLength >= PATH_MAX) {
    QRTLogAs(kLogError, "diskUsageForURL", "Failed to create path to child directory by appending \"%s\" to %@",
             name, path);
    return;
  }
  std::string child;
  child.reserve(path.size() + 1 + nameLength);
  child.append(path);
  if (needsSeparator) child.push_back('/');
  child.append(name, nameLength);
  children_.push_back(std::move(child));
}

void DirectoryReader::countFile(const struct statx& attributes, const std::string& path, const char* name) {
  const uint64_t allocated = (attributes.stx_mask & STATX_BLOCKS) ? attributes.stx_blocks * 512 : 0;
  const uint32_t links = (attributes.stx_mask & STATX_NLINK) ? attributes.stx_nlink : 0;
  if (links != 1) {
    const uint64_t inode = (attributes.stx_mask & STATX_INO) ? attributes.stx_ino : 0;
    if (!walk_.firstSighting({makedev(attributes.stx_dev_major, attributes.stx_dev_minor), inode})) {
      QRTLogAs(kLogDebug, "diskUsageForURL", "Skipping hardlinked file at %@/%s", path, name);
      return;
    }
  }
  total_ += allocated;
}

void logTreeEntry(const FTSENT* entry) {
  switch (entry->fts_info) {
    case FTS_DP:
      return;
    case FTS_D:
    case FTS_F:
    case FTS_SL:
    case FTS_SLNONE:
    case FTS_DEFAULT:
      QRTLogAs(kLogError, "printDirectoryStructureAtURL", "\tOrphaned File: %s", entry->fts_path);
      return;
    default:
      QRTLogAs(kLogError, "printDirectoryStructureAtURL", "FTS returned error for %s : %s", entry->fts_path,
               errorText(entry->fts_errno));
      return;
  }
}

}  // namespace

uint64_t QRTFileManager::diskUsageForURL(const QRTURL& url) {
  if (url.empty()) {
    QRTLog(kLogError, "Failed to get path to url %@", url);
    return 0;
  }
  try {
    return DiskUsageWalk(url.path()).run();
  } catch (...) {
    QRT_EXCEPTION_ERROR();  // logs it; only allocation can throw here
    return 0;
  }
}

namespace {

// The item itself, never a link's target; -1 with the error on failure.
int openForClass(const char* function, const char* path, QRTErrorRef* error) {
  int fd = open(path, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
  if (fd < 0) {
    int err = errno;
    QRTSetError(error, QRTCreatePOSIXError(function, __LINE__, err, "Failed to open %s : %s", path, errorText(err)));
  }
  return fd;
}

bool readClass(const char* function, int fd, const char* path, int32_t* current, QRTErrorRef* error) {
  if (int err = QRTGetProtectionClass(fd, current)) {
    QRTSetError(error, QRTCreatePOSIXError(function, __LINE__, err, "Failed to getclass of file %s: %s", path,
                                           errorText(err)));
    return false;
  }
  return true;
}

}  // namespace

bool QRTFileManager::dataProtectionClassOfItemAtURL(const QRTURL& url, int32_t* cls, QRTErrorRef* error) {
  const char* path = url.fileSystemRepresentation();
  ScopedFd fd(openForClass(__func__, path, error));
  if (!fd.valid()) return false;
  int32_t current = 0;
  if (!readClass(__func__, fd.get(), path, &current, error)) return false;
  if (cls) *cls = current;
  return true;
}

bool QRTFileManager::setDataProtectionClassOfItemAtURL(const QRTURL& url, int32_t toClass,
                                                       const std::function<bool(int32_t)>& ifPredicate,
                                                       QRTErrorRef* error) {
  const char* path = url.fileSystemRepresentation();
  ScopedFd fd(openForClass(__func__, path, error));
  if (!fd.valid()) return false;
  if (ifPredicate) {
    int32_t current = 0;
    if (!readClass(__func__, fd.get(), path, &current, error)) return false;
    try {
      if (!ifPredicate(current)) return true;
    } catch (...) {
      QRTSetError(error, QRT_EXCEPTION_ERROR());
      return false;
    }
  }
  if (int err = QRTSetProtectionClass(fd.get(), toClass)) {
    QRTSetError(error,
                QRT_POSIX_ERROR(err, "Failed to setclass(%d) on file %s: %s", toClass, path, errorText(err)));
    return false;
  }
  return true;
}

void QRTFileManager::printDirectoryStructureAtURL(const QRTURL& url) {
  char* roots[] = {const_cast<char*>(url.fileSystemRepresentation()), nullptr};
  FTS* fts = fts_open(roots, FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV, nullptr);
  if (!fts) {
    QRTLog(kLogError, "fts_open failed for %@ : %s", url, errorText(errno));
    return;
  }
  while (const FTSENT* entry = fts_read(fts)) logTreeEntry(entry);
  fts_close(fts);
}
