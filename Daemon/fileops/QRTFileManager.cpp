#include "Daemon/fileops/QRTFileManager.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <utility>

#include "base/QRTFormat.h"
#include "platform/Dir.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/Random.h"
#include "platform/SafePath.h"
#include "platform/TreeCopy.h"
#include "platform/TreeRemove.h"
#include "platform/TreeWalk.h"

using platform::kLogError;
using platform::SafeParent;

QRTFileManager& QRTFileManager::defaultManager() {
  static QRTFileManager manager;
  return manager;
}

bool QRTFileManager::removeItemAtURL(const QRTURL& url, QRTErrorRef* error) {
  if (url.empty()) {
    QRTSetError(error, QRT_POSIX_ERROR(EFAULT, "nil url passed to -removeItemAtURL:error:"));
    return false;
  }
  SafeParent parent;
  int err = platform::safeOpenParent(url.path(), &parent);
  if (err == 0) err = platform::removeTree(parent.fd.get(), parent.name, url.path());
  if (err != 0 && err != ENOENT) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "prunetree of %@ failed: %s", url, errorText(err)));
    return false;
  }
  return true;
}

bool QRTFileManager::createDirectoryAtURL(const QRTURL& url, bool withIntermediateDirectories, mode_t mode,
                                          uint32_t owner, int32_t protectionClass, QRTErrorRef* error) {
  return createDirectory(nullptr, url.path(), url, withIntermediateDirectories, mode, owner, protectionClass, nullptr,
                         error);
}

bool QRTFileManager::createDirectory(const platform::Dir* in, std::string_view relative, const QRTURL& url,
                                     bool withIntermediateDirectories, mode_t mode, uint32_t owner,
                                     int32_t protectionClass, platform::Dir* out, QRTErrorRef* error) {
  const char* path = url.fileSystemRepresentation();
  platform::Dir made;
  const uid_t wanted = owner == 0 ? platform::kAnyOwner : owner;
  if (int err = in ? in->makeDirectory(relative, mode, withIntermediateDirectories, wanted, &made, nullptr, url.path())
                   : platform::Dir::make(relative, mode, withIntermediateDirectories, wanted, &made)) {
    if (withIntermediateDirectories)
      QRTSetError(error, QRT_POSIX_ERROR(err, "ensuredirs of %s failed: %s", path, errorText(err)));
    else
      QRTSetError(error, QRT_POSIX_ERROR(err, "mkdir of %s failed: %s", path, errorText(err)));
    return false;
  }
  if (protectionClass != -1) {
    if (int err = platform::setProtectionClass(made.fd(), protectionClass)) {
      QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to setclass(%d) on directory %s: %s", protectionClass, path,
                                         errorText(err)));
      return false;
    }
  }
  if (out) *out = std::move(made);
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

// The parents of a copy's or move's two ends. With failIfSrcMissing false a
// missing source is reported as *missing (and true); *resolveError holds what
// stopped the opening of either parent.
static bool openEnds(const char* function, const QRTURL& src, const QRTURL& toURL, bool failIfSrcMissing,
                     SafeParent* from, SafeParent* to, bool* missing, int* resolveError, QRTErrorRef* error) {
  *missing = false;
  int err = *resolveError = platform::safeOpenParent(src.path(), from);
  if (!failIfSrcMissing) {
    struct stat st;
    if (!err && fstatat(from->fd.get(), from->name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) err = errno;
    if (err == ENOENT) *missing = true;
    if (err != 0 && err != ENOENT) return statFailed(function, src, err, error);
  }
  if (!*resolveError && !*missing) *resolveError = platform::safeOpenParent(toURL.path(), to);
  return true;
}

bool QRTFileManager::_copyItemAtURL(const QRTURL& src, const QRTURL& toURL, bool failIfSrcMissing, QRTErrorRef* error) {
  SafeParent from, to;
  bool missing;
  int err;
  if (!openEnds(__func__, src, toURL, failIfSrcMissing, &from, &to, &missing, &err, error)) return false;
  if (missing) return true;
  if (!err) err = platform::copyTree(from.fd.get(), from.name.c_str(), to.fd.get(), to.name.c_str());
  if (err) {
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

// Reports a failed move; always false.
static bool moveFailed(int err, const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  QRTSetError(error, QRT_POSIX_ERROR(err, "rename of %@ to %@ failed: %s", src, toURL, errorText(err)));
  return false;
}

bool QRTFileManager::_moveItemAtURL(const QRTURL& src, const QRTURL& toURL, bool failIfSrcMissing, QRTErrorRef* error) {
  SafeParent from, to;
  bool missing;
  int err;
  if (!openEnds(__func__, src, toURL, failIfSrcMissing, &from, &to, &missing, &err, error)) return false;
  if (missing) return true;
  if (err) return moveFailed(err, src, toURL, error);
  const platform::Dir fromDir(std::move(from.fd), {}), toDir(std::move(to.fd), {});
  return moveItem(fromDir, from.name, toDir, to.name, src, toURL, error);
}

bool QRTFileManager::moveItem(const platform::Dir& from, std::string_view name, const platform::Dir& to,
                              std::string_view toName, const QRTURL& src, const QRTURL& toURL, QRTErrorRef* error) {
  // EXDEV stays an error: a copy would turn hard links into separate files
  // and write sparse files out in full, as root.
  if (int err = from.renameInto(name, to, toName)) return moveFailed(err, src, toURL, error);
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
  const std::string prefix(withNamePrefix);
  platform::Dir directory;
  std::string name;
  int err = platform::Dir::open(parent.path(), &directory);
  if (!err) err = directory.makeTemporaryDirectory(prefix, S_IRWXU, &name);
  if (!err) return parent.URLByAppendingPathComponent(name, true);
  std::string path = parent.URLByAppendingPathComponent(prefix + "XXXXXX", true).path();
  QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to create temp dir at path %s : %s", path, errorText(err)));
  return std::nullopt;
}

std::optional<QRTURL> QRTFileManager::createTemporaryDirectoryInDirectoryURL(const QRTURL& parent, QRTErrorRef* error) {
  return createTemporaryDirectoryInDirectoryURL(parent, "temp.", error);
}

bool QRTFileManager::_traverseDirectory(const QRTURL& root, QRTErrorRef* error, const QRTTraversalVisitor& withBlock) {
  QRTErrorRef stopError;
  int err = platform::walkTree(root.path(), [&](QRTTraversalEntry& entry) {
    QRTErrorRef visitorError;
    if (withBlock(entry, &visitorError)) return true;
    stopError = std::move(visitorError);
    return false;
  });
  if (err == 0) return true;
  if (err != platform::kTreeWalkStopped)
    stopError = QRT_POSIX_ERROR(err, "Error for path %s: %s", root.fileSystemRepresentation(), errorText(err));
  if (stopError) QRTSetError(error, stopError);
  return false;
}

std::optional<std::vector<QRTURL>> QRTFileManager::urlsForItemsInDirectoryAtURL(const QRTURL& url, QRTErrorRef* error) {
  platform::Dir directory;
  std::vector<platform::Dir::Entry> entries;
  int err = platform::Dir::open(url.path(), &directory);
  if (err) {
    if (err != ENOENT)
      QRTLogAs(kLogError, "_IterateDirectory", "opendir of %s failed: %s", url.fileSystemRepresentation(),
               errorText(err));
  } else {
    err = directory.list(&entries);
  }
  if (err) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "_IterateDirectory for %@ returned %s", url, errorText(err)));
    return std::nullopt;
  }
  std::vector<QRTURL> urls;
  for (const platform::Dir::Entry& entry : entries)
    if (entry.name[0] != '.') urls.push_back(url.URLByAppendingPathComponent(entry.name, entry.directory));
  return urls;
}

bool QRTFileManager::itemExistsAtURL(const QRTURL& url) {
  struct stat st;
  int err = platform::safeStat(url.path(), &st);
  if (err == 0) return true;
  if (err != ENOENT) QRTLog(kLogError, "Failed to determine if %@ exists: %s", url, errorText(err));
  return false;
}

bool QRTFileManager::itemDoesNotExistAtURL(const QRTURL& url) {
  struct stat st;
  int err = platform::safeStat(url.path(), &st);
  if (err == 0) return false;
  if (err == ENOENT) return true;
  QRTLog(kLogError, "Failed to determine if %@ exists: %s", url, errorText(err));
  return false;
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

std::string stringWithFileSystemRepresentation(const char* bytes) { return bytes ? std::string(bytes) : std::string(); }

int QRTGetProtectionClass(int fd, int32_t* cls) { return platform::getProtectionClass(fd, cls); }

int QRTSetProtectionClass(int fd, int32_t cls) { return platform::setProtectionClass(fd, cls); }
