#include "Daemon/dataprotection/QRTDataProtectionChangeOperation.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "base/QRTFormat.h"
#include "Daemon/QRTCrashPoint.h"
#include "Daemon/QRTProcessWide.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTLocks.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/TreeWalk.h"

using platform::kLogDebug;
using platform::kLogError;
using platform::kLogNotice;

namespace {

constexpr const char* kIdentifierKey = "QRTDataOperationIdentifier";
constexpr const char* kContainerClassKey = "QRTDataOperationContainerClass";
constexpr const char* kUserIdKey = "QRTDataOperationUserId";
constexpr const char* kProtectionClassKey = "QRTDataOperationProtectionClass";
constexpr const char* kChangeTypeKey = "QRTDataOperationChangeType";
constexpr const char* kRetryIfLockedKey = "QRTDataOperationRetryIfLocked";
constexpr const char* kInternalIDKey = "QRTDataOperationInternalID";

// The class files get when the requested class is "none".
constexpr int32_t kDefaultFileClass = 3;
// Items that keep their class whatever is asked.
constexpr int32_t kUntouchableClass = 2;

const plist::Integer* integerAt(const plist::Dictionary& d, const char* key) {
  const plist::Value* v = plist::find(d, key);
  return v ? v->integerIf() : nullptr;
}

// What a value found in the file is, for the messages.
plist::Value foundValue(const plist::Dictionary& d, const char* key) {
  const plist::Value* v = plist::find(d, key);
  return v ? *v : plist::Value(std::string("(null)"));
}

QRTClientConnection& internalClient() { return QRTClientConnection::sharedClientConnection(); }

// ---- the walk -----------------------------------------------------------

// A physical walk on the root's file system through descriptors: each item is
// opened relative to its parent's descriptor without following a link,
// checked with fstat, and read and changed only through that descriptor.
// Entry types come from the directory listing, so a file costs one open and
// one class read, and only when it changes one fstat and one class write; a
// file the change type leaves alone is not even opened. Directories are
// changed after their contents.
class ProtectionWalk {
 public:
  ProtectionWalk(const QRTURL& root, int32_t newClass, uint32_t changeType)
      : root_(root), newClass_(newClass), changeType_(changeType) {}
  // False with *error when the walk stopped; locked() when the file system
  // refused a change because the device is locked.
  bool run(QRTErrorRef* error);
  bool locked() const { return locked_; }

 private:
  bool visit(const platform::TreeEntry& entry);
  bool visitRoot(const platform::TreeEntry& entry);
  bool listed(platform::TreeListing& listing);
  // The conditional setter on an open item. One not yet checked is checked
  // only when the rules call for a change: a file read as not to be changed
  // costs no fstat.
  bool change(int fd, bool directory, bool checked);
  bool stillRegularFileHere(int fd) const;
  bool changes(uint32_t what) const { return (changeType_ & what) != 0; }
  void logEntryError(int err) const {
    QRTLogAs(kLogError, "_runChangeOperationNeedToRetry", "FTS returned error for %s : %s", path_.c_str(),
             errorText(err));
  }

  const QRTURL& root_;
  const int32_t newClass_;
  const uint32_t changeType_;
  dev_t device_ = 0;
  bool locked_ = false;
  size_t changed_ = 0;
  bool started_ = false;  // the root was reached
  std::string path_;      // of the entry being visited
  // The levels whose directory could not be listed: neither entered nor
  // changed.
  std::vector<bool> unlisted_;
  QRTErrorRef error_;
};

constexpr int kOpenFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;

// Gone, or swapped for a link, a special file or another directory since it
// was listed.
bool vanished(int err) { return err == ENOENT || err == ELOOP || err == ENXIO || err == ENOTDIR || err == ESTALE; }

bool ProtectionWalk::run(QRTErrorRef* error) {
  platform::TreeWalkOptions options;
  options.typesFromListing = true;
  options.onListing = [this](platform::TreeListing& listing) { return listed(listing); };
  const std::string rootPath = root_.path();
  int err = platform::walkTree(
      rootPath, [this](platform::TreeEntry& entry) { return visit(entry); }, options);
  if (err == 0 || err == ENOENT || err == ELOOP) return true;  // gone meanwhile, or a link: nothing of ours to walk
  if (err != platform::kTreeWalkStopped) {
    // Only a directory closed for depth and moved meanwhile stops the walk.
    error_ = started_ ? QRT_POSIX_ERROR(err, "Error for path %s: %s", path_.c_str(), errorText(err))
                      : QRT_POSIX_ERROR(err, "fts_open failed for %@ : %s", root_, errorText(err));
  }
  QRTSetError(error, std::move(error_));
  return false;
}

bool ProtectionWalk::visitRoot(const platform::TreeEntry& entry) {
  using Kind = platform::TreeEntry::Kind;
  device_ = entry.st.st_dev;
  started_ = true;
  int err = entry.error;
  if (entry.kind == Kind::DirectoryPre) return true;
  if (!err && entry.kind != Kind::File) return true;
  platform::UniqueFd fd;
  struct stat opened;
  if (!err) {
    fd.reset(platform::openNoFollowAt(entry.parentFd, entry.name, kOpenFlags));
    err = !fd.valid() ? errno : fstat(fd.get(), &opened) != 0 ? errno : 0;
  }
  if (vanished(err)) return true;
  if (err) {
    error_ = QRT_POSIX_ERROR(err, "fts_open failed for %@ : %s", root_, errorText(err));
    return false;
  }
  if (opened.st_ino != entry.st.st_ino || opened.st_dev != entry.st.st_dev) return true;  // swapped since
  return !changes(QRTDataProtectionChangeOperation::QRTChangeFiles) || change(fd.get(), false, true);
}

bool ProtectionWalk::visit(const platform::TreeEntry& entry) {
  using Kind = platform::TreeEntry::Kind;
  path_ = entry.path;
  if (entry.level == 0 && entry.kind != Kind::DirectoryPost) return visitRoot(entry);
  switch (entry.kind) {
    case Kind::Other:
      // An unreadable item is reported and passed over, as the walk goes on.
      if (entry.error && !vanished(entry.error)) logEntryError(entry.error);
      return true;
    case Kind::DirectoryPost: {
      const auto level = static_cast<size_t>(entry.level);
      const bool listedWhole = level >= unlisted_.size() || !unlisted_[level];
      if (level < unlisted_.size()) unlisted_[level] = false;
      // Another file system's directory has no descriptor: never changed.
      if (entry.fd < 0 || !listedWhole || !changes(QRTDataProtectionChangeOperation::QRTChangeDirectories)) return true;
      return change(entry.fd, true, true);
    }
    case Kind::File: {
      if (!changes(QRTDataProtectionChangeOperation::QRTChangeFiles)) return true;
      platform::UniqueFd fd(platform::openNoFollowAt(entry.parentFd, entry.name, kOpenFlags));
      if (!fd.valid()) {
        if (!vanished(errno)) logEntryError(errno);
        return true;
      }
      return change(fd.get(), false, false);
    }
    default: return true;  // links are never followed; directories wait for their contents
  }
}

// A directory that cannot be listed whole is reported, and neither entered
// nor changed. The rest go in inode order, which on ext4 is about the order
// of allocation: consecutive class writes then touch the same inode table
// blocks.
bool ProtectionWalk::listed(platform::TreeListing& listing) {
  if (!listing.error) {
    std::sort(listing.entries->begin(), listing.entries->end(),
              [](const platform::TreeListedEntry& a, const platform::TreeListedEntry& b) { return a.inode < b.inode; });
    return true;
  }
  path_ = listing.path;
  logEntryError(listing.error);
  listing.entries->clear();
  const auto level = static_cast<size_t>(listing.level);
  if (unlisted_.size() <= level) unlisted_.resize(level + 1);
  unlisted_[level] = true;
  return true;
}

// Another file system, or swapped since listed: left alone.
bool ProtectionWalk::stillRegularFileHere(int fd) const {
  struct stat st;
  if (fstat(fd, &st) != 0) {
    if (!vanished(errno)) logEntryError(errno);
    return false;
  }
  return st.st_dev == device_ && S_ISREG(st.st_mode);
}

bool ProtectionWalk::change(int fd, bool directory, bool checked) {
  const int32_t target = directory ? newClass_ : (newClass_ == 0 ? kDefaultFileClass : newClass_);
  int32_t current = 0;
  QRTErrorRef failure;
  int err = platform::getProtectionClass(fd, &current);
  if (!err && current == kUntouchableClass) return true;
  if (!err && !directory) {
    if (current == target) return true;
    if ((changeType_ & QRTDataProtectionChangeOperation::QRTChangeFilesOnlyToLowerClass) && target >= current)
      return true;
  }
  if (!checked && !stillRegularFileHere(fd)) return true;
  if (err) {
    failure = QRT_POSIX_ERROR(err, "Failed to getclass of file %s: %s", path_.c_str(), errorText(err));
  } else {
    QRTLog(kLogDebug, "Setting protection class of %s to %d", path_.c_str(), target);
    if (!(err = platform::setProtectionClass(fd, target, current))) {
      if (++changed_ == 10) QRT_CRASH_POINT("protection-mid-walk");
      return true;
    }
    failure = QRT_POSIX_ERROR(err, "Failed to setclass(%d) on file %s: %s", target, path_.c_str(), errorText(err));
  }
  if (err == EBADF) {
    struct stat st {};
    fstat(fd, &st);
    QRTLogAs(kLogError, "_runChangeOperationNeedToRetry",
             "Ignoring failure to set protection class to %d on %@ (mode 0%o): %@", newClass_, path_,
             static_cast<unsigned>(st.st_mode), failure);
    return true;
  }
  if (err == EPERM) locked_ = true;
  error_ = std::move(failure);
  return false;
}

}  // namespace

bool QRTDataProtectionChangeOperation::setProtectionClassOfTreeAtURL(const QRTURL& root, int32_t newClass,
                                                                     uint32_t changeType, bool* locked,
                                                                     QRTErrorRef* error) {
  ProtectionWalk walk(root, newClass, changeType);
  bool ok = walk.run(error);
  if (locked) *locked = walk.locked();
  return ok || walk.locked();
}

// ---- pending-update files ---------------------------------------------------

QRTURL QRTDataProtectionChangeOperation::urlForProtectionOperationWithIdentifier(const std::string& identifier,
                                                                                 uint64_t containerClass,
                                                                                 uint32_t userId) {
  const std::string name =
      QRTFormat("%@-%llu-%u.plist", identifier, static_cast<unsigned long long>(containerClass), userId);
  return QRTGlobalConfiguration::sharedInstance().pendingUpdatesDirectory().URLByAppendingPathComponent(name);
}

std::optional<plist::Dictionary> QRTDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(
    const std::optional<QRTURL>& url, QRTErrorRef* error) {
  if (!url) {
    QRTSetError(error, QRT_ERROR(QRTErrorInvalidArgument, nullptr, false, "URL cannot be nil"));
    return std::nullopt;
  }
  QRTErrorRef readError;
  std::optional<plist::Dictionary> d = QRT_dictionaryWithContentsOfURL(*url, &readError);
  if (!d) {
    QRTSetError(error, QRT_ERROR(QRTErrorReadFailed, readError, false, "Failed to read update info at URL %@", *url));
    return std::nullopt;
  }
  auto invalid = [&](QRTErrorRef e) {
    QRTSetError(error, std::move(e));
    return std::nullopt;
  };
  const plist::Value* identifier = plist::find(*d, kIdentifierKey);
  if (!identifier || !identifier->isString())
    return invalid(QRT_ERROR(QRTErrorInvalidMetadata, nullptr, false, "Invalid update info Identifier: %@ at %@",
                             foundValue(*d, kIdentifierKey), *url));
  const plist::Integer* containerClass = integerAt(*d, kContainerClassKey);
  if (!containerClass || containerClass->asUnsigned() < QRTClassAppBundle ||
      containerClass->asUnsigned() > QRTClassSystemGroup)
    return invalid(QRT_ERROR(QRTErrorInvalidMetadata, nullptr, false, "Invalid update info container class: %ld at %@",
                             static_cast<long>(containerClass ? containerClass->asSigned() : 0), *url));
  if (!integerAt(*d, kUserIdKey))
    return invalid(QRT_ERROR(QRTErrorInvalidMetadata, nullptr, false, "Invalid update info user id: %@ at %@",
                             foundValue(*d, kUserIdKey), *url));
  if (!integerAt(*d, kProtectionClassKey))
    return invalid(QRT_ERROR(QRTErrorInvalidMetadata, nullptr, false, "Invalid update info protection class: %@ at %@",
                             foundValue(*d, kProtectionClassKey), *url));
  if (!integerAt(*d, kChangeTypeKey))
    return invalid(QRT_ERROR(QRTErrorInvalidMetadata, nullptr, false, "Invalid update info change type: %@ at %@",
                             foundValue(*d, kChangeTypeKey), *url));
  const plist::Value* retry = plist::find(*d, kRetryIfLockedKey);
  if (!retry || !(retry->isBoolean() || retry->isInteger()))
    return invalid(QRT_ERROR(QRTErrorInvalidMetadata, nullptr, false, "Invalid update info retry: %@ at %@",
                             foundValue(*d, kRetryIfLockedKey), *url));
  const plist::Value* uuid = plist::find(*d, kInternalIDKey);
  if (!uuid || !uuid->isString())
    return invalid(QRT_ERROR(QRTErrorInvalidMetadata, nullptr, false, "Invalid update info UUID String: %@ at %@",
                             foundValue(*d, kInternalIDKey), *url));
  if (!QRTUUID::fromString(uuid->string()))
    return invalid(
        QRT_ERROR(QRTErrorInvalidMetadata, nullptr, false, "Invalid update info UUID: %@ at %@", uuid->string(), *url));
  return d;
}

QRTDataProtectionChangeOperation::Ref QRTDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
    const QRTURL& url, QueueRef queue, QueueRef lockStateQueue, QRTErrorRef* error) {
  QRTErrorRef readError;
  auto d = _readAndValidateDataProtectionUpdateAtURL(url, &readError);
  if (!d) {
    QRTLog(kLogError, "Failed to read data protection update at %@", url);
    QRTSetError(error, readError);
    return nullptr;
  }
  const std::string identifier = plist::find(*d, kIdentifierKey)->string();
  const uint64_t containerClass = integerAt(*d, kContainerClassKey)->asUnsigned();
  const auto userId = static_cast<uint32_t>(integerAt(*d, kUserIdKey)->asUnsigned());
  uint64_t code = QRTErrorNone;
  QRTMetadataRef metadata = internalClient().createOrLookupContainerForUser(
      {userId, containerClass, identifier}, QRTCreateMode::LookupOnly, QRTLocking::TakeLocks, &code);
  if (!metadata) {
    QRTSetError(error, QRT_ERROR(QRTErrorNotFound, nullptr, false,
                                 "Failed to lookup container metadata from file userId: %u, identifier: %@, Class: "
                                 "%llu : %llu",
                                 userId, identifier, static_cast<unsigned long long>(containerClass),
                                 static_cast<unsigned long long>(code)));
    return nullptr;
  }
  const plist::Value* retry = plist::find(*d, kRetryIfLockedKey);
  const bool retryIfLocked = retry->isBoolean() ? retry->boolean() : retry->integer().bits != 0;
  return std::make_shared<QRTDataProtectionChangeOperation>(
      std::move(metadata), static_cast<int32_t>(integerAt(*d, kProtectionClassKey)->asSigned()), retryIfLocked,
      static_cast<uint32_t>(integerAt(*d, kChangeTypeKey)->asUnsigned()),
      QRTUUID::fromString(plist::find(*d, kInternalIDKey)->string()), std::move(queue), std::move(lockStateQueue));
}

bool QRTDataProtectionChangeOperation::deleteUpdateFileWithIdentifier(const std::string& identifier,
                                                                      uint64_t containerClass, uint32_t userId,
                                                                      QRTErrorRef* error) {
  const QRTURL url = urlForProtectionOperationWithIdentifier(identifier, containerClass, userId);
  QRTErrorRef removeError;
  if (QRTFileManager::defaultManager().removeItemAtURL(url, &removeError)) return true;
  QRTLog(kLogError, "Failed to remove data protection file at %@ : %@", url, removeError);
  QRTSetError(error, removeError);
  return false;
}

QRTDataProtectionChangeOperation::Ref
QRTDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
    QRTMetadataRef metadata, int32_t settingClass, bool retryingIfLocked, uint32_t changeType, QueueRef queue,
    QueueRef lockStateQueue) {
  return std::make_shared<QRTDataProtectionChangeOperation>(std::move(metadata), settingClass, retryingIfLocked,
                                                            changeType, std::nullopt, std::move(queue),
                                                            std::move(lockStateQueue));
}

QRTDataProtectionChangeOperation::QRTDataProtectionChangeOperation(QRTMetadataRef metadata, int32_t newClass,
                                                                   bool retryingIfLocked, uint32_t changeType,
                                                                   std::optional<QRTUUID> internalChangeID,
                                                                   QueueRef queue, QueueRef lockStateQueue)
    : retryIfLocked_(retryingIfLocked),
      dataContainerMetadata_(std::move(metadata)),
      newDataProtectionClass_(newClass),
      changeType_(changeType),
      internalChangeID_(internalChangeID.value_or(QRTUUID::random())),
      queue_(std::move(queue)),
      lockStateQueue_(std::move(lockStateQueue)) {}

bool QRTDataProtectionChangeOperation::writeToDiskWithError(QRTErrorRef* error) {
  bool ok = false;
  queue_->sync([&] { ok = _onQueue_writeToDiskWithError(error); });
  return ok;
}

bool QRTDataProtectionChangeOperation::_stillMostCurrentUpdate() {
  bool current = false;
  queue_->sync([&] { current = _onQueue_stillMostCurrentUpdate(); });
  return current;
}

bool QRTDataProtectionChangeOperation::_deleteUpdateFileWithError(QRTErrorRef* error) {
  bool ok = false;
  queue_->sync([&] { ok = _onQueue_deleteUpdateFileWithError(error); });
  return ok;
}

bool QRTDataProtectionChangeOperation::_onQueue_writeToDiskWithError(QRTErrorRef* error) {
  const QRTMetadataRef& m = dataContainerMetadata_;
  if (!m || changeType_ == 0) {
    QRTSetError(error, QRT_ERROR(QRTErrorInvalidArgument, nullptr, false,
                                 "Invalid Update Info: metadata: %@, changeType: %u", m, changeType_));
    return false;
  }
  plist::Dictionary d{
      {kIdentifierKey, m->identifier()},
      {kContainerClassKey, static_cast<uint64_t>(m->containerClass())},
      {kUserIdKey, static_cast<uint64_t>(m->userId())},
      {kProtectionClassKey, static_cast<int64_t>(newDataProtectionClass_)},
      {kChangeTypeKey, static_cast<uint64_t>(changeType_)},
      {kRetryIfLockedKey, retryIfLocked_},
      {kInternalIDKey, internalChangeID_.UUIDString()},
  };
  const QRTURL url = urlForProtectionOperationWithIdentifier(m->identifier(), m->containerClass(), m->userId());
  QRTErrorRef fileError;
  if (!QRTFileManager::defaultManager().removeItemAtURL(url, &fileError)) {
    QRTSetError(error, QRT_ERROR(QRTErrorRemoveItemFailed, fileError, false,
                                 "Failed to remove pending data protection file at %@", url));
    return false;
  }
  if (!QRT_writeToURL(d, url, QRTWriteAtomic | QRTWriteFileProtectionNone, &fileError)) {
    QRTSetError(error, QRT_ERROR(QRTErrorWriteFailed, fileError, false,
                                 "Failed to write data protection update dictionary to URL %@", url));
    return false;
  }
  return true;
}

bool QRTDataProtectionChangeOperation::_onQueue_stillMostCurrentUpdate() {
  const QRTMetadataRef& m = dataContainerMetadata_;
  const QRTURL url = urlForProtectionOperationWithIdentifier(m->identifier(), m->containerClass(), m->userId());
  auto d = _readAndValidateDataProtectionUpdateAtURL(url, nullptr);
  if (!d) {
    QRTLog(kLogError, "Failed to read data protection update from %@", url);
    return false;
  }
  return QRTUUID::fromString(plist::find(*d, kInternalIDKey)->string()) == internalChangeID_;
}

bool QRTDataProtectionChangeOperation::_onQueue_deleteUpdateFileWithError(QRTErrorRef* error) {
  const QRTMetadataRef& m = dataContainerMetadata_;
  if (!_onQueue_stillMostCurrentUpdate()) {
    QRTLog(kLogNotice, "Nothing to delete because there is a newer update for user: %u, id: %@, containerClass: %llu",
           m->userId(), m->identifier(), static_cast<unsigned long long>(m->containerClass()));
    return true;
  }
  return deleteUpdateFileWithIdentifier(m->identifier(), m->containerClass(), m->userId(), error);
}

// ---- the run ---------------------------------------------------------------

bool QRTDataProtectionChangeOperation::_runChangeOperationNeedToRetry(bool* needToRetry, QRTErrorRef* error) {
  *needToRetry = false;
  try {
    return _runChange(needToRetry, error);
  } catch (...) {
    // The identifier lock went with the stack.
    QRTSetError(error, QRT_EXCEPTION_ERROR());
    return false;
  }
}

bool QRTDataProtectionChangeOperation::_runChange(bool* needToRetry, QRTErrorRef* error) {
  const QRTMetadataRef& m = dataContainerMetadata_;
  const auto containerClass = static_cast<unsigned long long>(m->containerClass());
  QRTIdentifierLock lock(m->uuid().UUIDString(), false);
  uint64_t code = QRTErrorNone;
  QRTMetadataRef found =
      internalClient().createOrLookupContainerForUser({m->userId(), m->containerClass(), m->identifier()},
                                                      QRTCreateMode::LookupOnly, QRTLocking::CallerHoldsLocks, &code);
  if (!found) {
    QRTSetError(error, QRT_ERROR(QRTErrorNotFound, nullptr, false,
                                 "Failed to lookup container to set data protection for userId: %u, identifier: %@, "
                                 "Class: %llu",
                                 m->userId(), m->identifier(), containerClass));
    return false;
  }
  if (found->url().path() != m->url().path()) {
    QRTSetError(error, QRT_ERROR(QRTErrorInvalidPath, nullptr, false,
                                 "Cancelling data protection operation because container path changed on disk. This "
                                 "indicates the app may have been updated and changed its protection level."));
    return false;
  }
  if (!_stillMostCurrentUpdate()) {
    QRTSetError(error, QRT_ERROR(QRTErrorSuperseded, nullptr, false,
                                 "Cancelling data protection operation because another more current operation on "
                                 "this container has taken precedence"));
    return false;
  }
  std::vector<QRTURL> roots;
  for (const std::string& name : QRTGlobalConfiguration::appUserDataItemNames()) {
    QRTURL item = m->url().URLByAppendingPathComponent(name);
    if (item.empty()) {
      QRTLog(kLogError, "itemURL is nil for item: %@", name);
      continue;
    }
    if (QRTFileManager::defaultManager().itemExistsAtURL(item)) roots.push_back(std::move(item));
  }
  QRT_PAUSE_POINT("protection-walk");
  for (const QRTURL& root : roots) {
    bool locked = false;
    if (!setProtectionClassOfTreeAtURL(root, newDataProtectionClass_, changeType_, &locked, error)) return false;
    if (locked) {
      *needToRetry = true;
      return true;
    }
  }
  return true;
}

void QRTDataProtectionChangeOperation::performChangeOperation() {
  const QRTMetadataRef& m = dataContainerMetadata_;
  const auto containerClass = static_cast<unsigned long long>(m->containerClass());
  bool needToRetry = false;
  QRTErrorRef error;
  if (!_runChangeOperationNeedToRetry(&needToRetry, &error)) {
    needToRetry = false;
    QRTLog(kLogNotice,
           "Operation to update protection classes for user: %u, id: %@, containerClass: %llu to class %d failed "
           "with error %@",
           m->userId(), m->identifier(), containerClass, newDataProtectionClass_, error);
  }
  if (needToRetry && retryIfLocked_) {
    QRTLog(kLogNotice,
           "Retrying container protection update to %d on next unlock for user: %u, id: %@, "
           "containerClass: %llu",
           newDataProtectionClass_, m->userId(), m->identifier(), containerClass);
    // The queue runs only while the device is unlocked.
    run_async_with_transaction(*lockStateQueue_, [self = shared_from_this()] {
      if (!self->retried_ && self->retryStartBlock_) self->retryStartBlock_();
      self->retried_ = true;
      self->performChangeOperation();
    });
    return;
  }
  if (needToRetry) {
    error = QRT_ERROR(QRTErrorProtectionLockedNoRetry, error, false,
                      "Tried to update user: %u, id: %@, containerClass: %llu to protection class %d, but was locked "
                      "and didn't retry",
                      m->userId(), m->identifier(), containerClass, newDataProtectionClass_);
  }
  QRT_CRASH_POINT("protection-before-pending-delete");
  if (!_deleteUpdateFileWithError(nullptr)) {
    QRTLog(kLogError, "Failed to delete update file for user: %u, id: %@, containerClass: %llu, protection class %d",
           m->userId(), m->identifier(), containerClass, newDataProtectionClass_);
  }
  if (completionBlock_) completionBlock_(needToRetry, error);
}
