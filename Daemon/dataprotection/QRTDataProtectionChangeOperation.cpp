#include "Daemon/dataprotection/QRTDataProtectionChangeOperation.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "Daemon/QRTCrashPoint.h"
#include "Daemon/QRTDaemon.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTLocks.h"
#include "platform/FileIO.h"
#include "platform/Log.h"

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

const char* errorText(int err) { return strerror(err); }

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

struct TreeChange {
  int32_t newClass;
  uint32_t changeType;
  dev_t device = 0;
  bool locked = false;
  size_t changed = 0;
};

// Opens the entry relative to its parent and checks that it is still the
// item the walk saw; false (and nothing opened) when it is gone or swapped.
int openEntry(const QRTTraversalEntry& entry, bool directory, platform::UniqueFd* fd, bool* same) {
  const int flags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC | (directory ? O_DIRECTORY : 0);
  fd->reset(openat(entry.parentFd, entry.name, flags | O_NOATIME));
  if (!fd->valid() && errno == EPERM) fd->reset(openat(entry.parentFd, entry.name, flags));
  *same = false;
  if (!fd->valid()) {
    // Gone, or swapped for a link or a special file since the listing.
    if (errno == ENOENT || errno == ELOOP || errno == ENXIO || errno == ENOTDIR) return 0;
    return errno;
  }
  struct stat st;
  if (fstat(fd->get(), &st) != 0) return errno;
  *same = st.st_dev == entry.st.st_dev && st.st_ino == entry.st.st_ino &&
          (st.st_mode & S_IFMT) == (entry.st.st_mode & S_IFMT);
  return 0;
}

// The conditional setter: the class is read from and set on the one open
// item. A failure is a POSIX error with the setter's messages.
bool setEntryClass(TreeChange& change, const QRTTraversalEntry& entry, bool directory, QRTErrorRef* error) {
  if (entry.st.st_dev != change.device) return true;  // another file system: never touched
  const int32_t target =
      directory ? change.newClass : (change.newClass == 0 ? kDefaultFileClass : change.newClass);
  platform::UniqueFd fd;
  bool same = false;
  int err = openEntry(entry, directory, &fd, &same);
  if (err) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to open %s : %s", entry.path, errorText(err)));
    return false;
  }
  if (!same) return true;
  int32_t current = 0;
  if ((err = platform::getProtectionClass(fd.get(), &current))) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to getclass of file %s: %s", entry.path, errorText(err)));
    return false;
  }
  if (current == kUntouchableClass) return true;
  if (!directory) {
    if (current == target) return true;
    if ((change.changeType & QRTDataProtectionChangeOperation::QRTChangeFilesOnlyToLowerClass) && target >= current)
      return true;
  }
  QRTLog(kLogDebug, "Setting protection class of %s to %d", entry.path, target);
  if ((err = platform::setProtectionClass(fd.get(), target, current))) {
    QRTSetError(error, QRT_POSIX_ERROR(err, "Failed to setclass(%d) on file %s: %s", target, entry.path,
                                       errorText(err)));
    return false;
  }
  if (++change.changed == 10) QRT_CRASH_POINT("protection-mid-walk");
  return true;
}

// The visitor's answer for one entry: false ends the walk.
bool visitEntry(TreeChange& change, QRTTraversalEntry& entry, QRTErrorRef* error) {
  using Kind = QRTTraversalEntry::Kind;
  if (entry.level == 0) change.device = entry.st.st_dev;
  bool directory = false;
  switch (entry.kind) {
    case Kind::DirectoryPre:
    case Kind::Symlink:
      return true;
    case Kind::Other:
      if (entry.error != 0)
        QRTLogAs(kLogError, "_runChangeOperationNeedToRetry", "FTS returned error for %s : %s", entry.path,
                 errorText(entry.error));
      return true;
    case Kind::DirectoryPost:
      if (!(change.changeType & QRTDataProtectionChangeOperation::QRTChangeDirectories)) return true;
      directory = true;
      break;
    case Kind::File:
      if (!(change.changeType & QRTDataProtectionChangeOperation::QRTChangeFiles)) return true;
      break;
  }
  QRTErrorRef setError;
  if (setEntryClass(change, entry, directory, &setError)) return true;
  if (setError && setError->code() == EBADF) {
    QRTLogAs(kLogError, "_runChangeOperationNeedToRetry",
             "Ignoring failure to set protection class to %d on %@ (mode 0%o): %@", change.newClass,
             std::string(entry.path), static_cast<unsigned>(entry.st.st_mode), setError);
    return true;
  }
  if (setError && setError->code() == EPERM) change.locked = true;
  QRTSetError(error, std::move(setError));
  return false;
}

}  // namespace

bool QRTDataProtectionChangeOperation::setProtectionClassOfTreeAtURL(const QRTURL& root, int32_t newClass,
                                                                     uint32_t changeType, bool* locked,
                                                                     QRTErrorRef* error) {
  TreeChange change{newClass, changeType};
  bool visitorFailed = false;
  QRTErrorRef walkError;
  bool ok = QRTFileManager::defaultManager()._traverseDirectory(
      root, &walkError, [&](QRTTraversalEntry& entry, QRTErrorRef* entryError) {
        bool go = visitEntry(change, entry, entryError);
        visitorFailed = !go;
        return go;
      });
  if (locked) *locked = change.locked;
  if (ok || change.locked) return true;
  if (!visitorFailed) {
    // The walk itself could not start or go on.
    const int err = walkError && walkError->domain() == QRTPOSIXErrorDomain ? walkError->code() : EIO;
    if (err == ENOENT) return true;  // the root went away meanwhile
    walkError = QRT_POSIX_ERROR(err, "fts_open failed for %@ : %s", root, errorText(err));
  }
  QRTSetError(error, walkError);
  return false;
}

// ---- pending-update files ---------------------------------------------------

QRTURL QRTDataProtectionChangeOperation::urlForProtectionOperationWithIdentifier(const std::string& identifier,
                                                                                 uint64_t containerClass,
                                                                                 uint32_t userId) {
  const std::string name = QRTFormat("%@-%llu-%u.plist", identifier, static_cast<unsigned long long>(containerClass),
                                     userId);
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
  if (!containerClass || containerClass->asUnsigned() < 1 || containerClass->asUnsigned() > 13)
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
    return invalid(QRT_ERROR(QRTErrorInvalidMetadata, nullptr, false, "Invalid update info UUID: %@ at %@",
                             uuid->string(), *url));
  return d;
}

QRTDataProtectionChangeOperation::Ref QRTDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
    const QRTURL& url, QueueRef queue, QRTErrorRef* error) {
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
  QRTMetadataRef metadata =
      internalClient().createOrLookupContainerForUser(userId, identifier, false, containerClass, false, true, &code);
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
      QRTUUID::fromString(plist::find(*d, kInternalIDKey)->string()), std::move(queue));
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

QRTDataProtectionChangeOperation::Ref QRTDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
    QRTMetadataRef metadata, int32_t settingClass, bool retryingIfLocked, uint32_t changeType, QueueRef queue) {
  return std::make_shared<QRTDataProtectionChangeOperation>(std::move(metadata), settingClass, retryingIfLocked,
                                                            changeType, std::nullopt, std::move(queue));
}

QRTDataProtectionChangeOperation::QRTDataProtectionChangeOperation(QRTMetadataRef metadata, int32_t newClass,
                                                                   bool retryingIfLocked, uint32_t changeType,
                                                                   std::optional<QRTUUID> internalChangeID,
                                                                   QueueRef queue)
    : retryIfLocked_(retryingIfLocked),
      dataContainerMetadata_(std::move(metadata)),
      newDataProtectionClass_(newClass),
      changeType_(changeType),
      internalChangeID_(internalChangeID.value_or(QRTUUID::random())),
      queue_(std::move(queue)) {}

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
  QRTMetadataRef found = internalClient().createOrLookupContainerForUser(m->userId(), m->identifier(), false,
                                                                         m->containerClass(), false, false, &code);
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
    QRTLog(kLogNotice, "Retrying container protection update to %d on next unlock for user: %u, id: %@, "
                       "containerClass: %llu",
           newDataProtectionClass_, m->userId(), m->identifier(), containerClass);
    // The queue runs only while the device is unlocked.
    run_async_with_transaction(QRTLockStateQueue(), [self = shared_from_this()] {
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
