#include "Daemon/store/QRTClientConnection.h"

#include <algorithm>
#include <cerrno>
#include <map>
#include <iterator>

#include "base/QRTUUID.h"
#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/QRTCrashPoint.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTLocks.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTWhitelist.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"
#include "Daemon/store/QRTClientConnectionInternal.h"

// ---- Replace ----
// A journal written before the first move lets the start-up recovery put the
// old container back when the daemon dies before the new one is in place.

using platform::kLogDebug;
using platform::kLogError;

namespace {

constexpr const char* kOldURLKey = "QRTReplaceOperationOldURL";
constexpr const char* kNewURLKey = "QRTReplaceOperationNewURL";
constexpr const char* kStagingURLKey = "QRTReplaceOperationStagingURL";
constexpr const char* kDestURLKey = "QRTReplaceOperationDestURL";
constexpr const char* kJournalKeys[] = {kOldURLKey, kNewURLKey, kStagingURLKey, kDestURLKey};
// A wipe keeps the old container's UUID: recorded before the first move so
// that the recovery can give it back to whichever content ends up live.
constexpr const char* kPreservedUUIDKey = "QRTReplaceOperationPreservedUUID";

// Errors and log lines carry the operation's name, whichever helper makes them.
constexpr const char* kReplace = "replaceContainer";
constexpr const char* kRecover = "_recoverFromReplaceOperationsWithError";
#define QRT_ERROR_AS(function, code, underlying, ...) \
  QRTCreateError((function), __LINE__, QRTErrorDomain, (code), (underlying), nullptr, true, __VA_ARGS__)

bool isValidClass(uint64_t containerClass) { return containerClass >= 1 && containerClass <= 13; }

// An unknown URL prints as (null).
std::optional<std::string> pathOrNil(const QRTURL& url) {
  if (url.empty()) return std::nullopt;
  return url.path();
}

std::optional<plist::Value> valueOrNil(const plist::Dictionary& dictionary, const char* key) {
  const plist::Value* value = plist::find(dictionary, key);
  if (!value) return std::nullopt;
  return *value;
}

// One replace in flight. The URLs stay empty until the step that knows them.
struct ReplaceJob {
  std::optional<QRTUUID> oldUUID;
  std::optional<QRTUUID> newUUID;
  uint32_t userIdOld;
  uint32_t userIdNew;
  std::optional<std::string> identifierOld;
  std::optional<std::string> identifierNew;
  uint64_t classOld;
  uint64_t classNew;
  bool preserveOldUUID;

  QRTMetadataRef oldContainer{};
  QRTMetadataRef newContainer{};
  QRTMetadataRef adopted{};  // the new container as the cache learns it at the destination
  QRTURL oldURL{};
  QRTURL newURL{};
  QRTURL destination{};
  QRTURL journal{};
  QRTURL staging{};
  bool destinationTransient = false;
  bool oldLeftCache = false;
  // A move back failed (a user can make one fail by swapping a directory of
  // theirs for a link): journal and staging stay for the start-up recovery.
  bool leftForRecovery = false;
};

// Everything that can be refused before the lock is taken.
QRTErrorRef checkReplaceArguments(const ReplaceJob& job) {
  if (!job.newUUID || !isValidClass(job.classNew)) {
    return QRT_ERROR_AS(kReplace, QRTErrorInvalidParameter, nullptr,
                        "Can't act on an invalid object: new userId: %u, newUUID: %@, Class: %ld", job.userIdNew,
                        job.newUUID, static_cast<long>(job.classNew));
  }
  if (!job.oldUUID) {
    if (!job.preserveOldUUID) return nullptr;
    return QRT_ERROR_AS(kReplace, QRTErrorInvalidParameter, nullptr,
                        "Can't have a nil oldContainerUUID when preserving the UUID");
  }
  if (!isValidClass(job.classOld)) {
    return QRT_ERROR_AS(kReplace, QRTErrorInvalidParameter, nullptr,
                        "Can't act on an invalid object: old userId: %u, oldUUID: %@, Class: %ld", job.userIdOld,
                        job.oldUUID, static_cast<long>(job.classOld));
  }
  if (job.classOld != job.classNew) {
    return QRT_ERROR_AS(kReplace, QRTErrorReplaceClassMismatch, nullptr,
                        "Can't replace containers of different class types: %ld and %ld",
                        static_cast<long>(job.classOld), static_cast<long>(job.classNew));
  }
  if (job.userIdOld != job.userIdNew) {
    return QRT_ERROR_AS(kReplace, QRTErrorReplaceUserMismatch, nullptr,
                        "Can't replace containers of different userIds: %u and %u", job.userIdOld, job.userIdNew);
  }
  return nullptr;
}

QRTMetadataRef findContainer(uint32_t userId, uint64_t containerClass, const std::optional<std::string>& identifier,
                             const QRTUUID& uuid, QRTErrorRef* error) {
  QRTMetadataRef found =
      QRTContainerCache::sharedInstance().containerForUser(userId, containerClass, identifier, uuid.UUIDString());
  if (!found) {
    QRTSetError(error, QRT_ERROR_AS(kReplace, QRTErrorNotFound, nullptr,
                                    "No Container with userId: %u UUID: %@, identifier: %@, Class: %ld", userId, uuid,
                                    identifier, static_cast<long>(containerClass)));
  }
  return found;
}

// Where the new container goes. Unless it takes over the old path, that place
// must be free.
QRTErrorRef computeDestination(ReplaceJob& job) {
  job.destinationTransient = job.oldContainer && job.oldContainer->transient();
  if (job.preserveOldUUID) {
    job.destination = job.oldURL;
    return nullptr;
  }
  std::optional<QRTURL> classDirectory = QRTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
      job.userIdNew, job.classNew, job.destinationTransient);
  if (!classDirectory) {
    return QRT_ERROR_AS(kReplace, QRTErrorInvalidPath, nullptr, "No class directory for userId: %u, class: %ld",
                        job.userIdNew, static_cast<long>(job.classNew));
  }
  job.destination = classDirectory->URLByAppendingPathComponent(job.newURL.lastPathComponent(), true);
  if (QRTFileManager::defaultManager().itemExistsAtURL(job.destination)) {
    return QRT_ERROR_AS(kReplace, QRTErrorAlreadyExists, nullptr, "Container already exists at %@", job.destination);
  }
  return nullptr;
}

// Both containers, and where the new one goes.
QRTErrorRef locateContainers(ReplaceJob& job) {
  QRTErrorRef error;
  if (job.oldUUID) {
    job.oldContainer = findContainer(job.userIdOld, job.classOld, job.identifierOld, *job.oldUUID, &error);
    if (!job.oldContainer) return error;
    job.oldURL = job.oldContainer->url();
  }
  job.newContainer = findContainer(job.userIdNew, job.classNew, job.identifierNew, *job.newUUID, &error);
  if (!job.newContainer) return error;
  job.newURL = job.newContainer->url();
  if (job.oldContainer && job.oldURL == job.newURL) {
    return QRT_ERROR_AS(kReplace, QRTErrorReplaceSameContainer, nullptr, "Can't replace the same container at %@",
                        job.newURL);
  }
  if (!QRTUUID::fromString(job.newURL.lastPathComponent())) {
    return QRT_ERROR_AS(kReplace, QRTErrorInvalidPath, nullptr, "Invalid URL (last path component not UUID): %@",
                        job.newURL);
  }
  if ((error = computeDestination(job))) return error;
  if (job.oldUUID) return nullptr;

  // A promotion must not shadow a permanent container of the same identifier.
  QRTErrorRef lookupError;
  if (QRTContainerCache::sharedInstance().containerForUser({job.userIdNew, job.classNew, job.identifierNew},
                                                           &lookupError)) {
    return QRT_ERROR_AS(kReplace, QRTErrorAlreadyExists, nullptr,
                        "Container with identifier: %@, class: %ld, transient: %d already exists", job.identifierNew,
                        static_cast<long>(job.classNew), 0);
  }
  if (!hasCode(lookupError, QRTErrorDomain, QRTErrorNotFound)) return lookupError;
  return nullptr;
}

// The cache forgets the new container where it was and learns it at the
// destination under the old one's identity. The metadata file already holds
// whatever UUID the entry carries.
QRTErrorRef adoptNewContainer(ReplaceJob& job) {
  QRTContainerCache& cache = QRTContainerCache::sharedInstance();
  QRTErrorRef underlying;
  if (!cache.removeContainerForUser(job.userIdNew, job.classNew, job.identifierNew, job.newContainer->transient(),
                                    &underlying)) {
    return QRT_ERROR_AS(kReplace, QRTErrorCacheRemoveFailed, underlying,
                        "Failed to remove from cache id: %@, class: %ld, transient: %d", job.identifierNew,
                        static_cast<long>(job.classNew), job.newContainer->transient());
  }
  if (!cache.addContainerMetadata(job.adopted, job.userIdNew, job.destination, job.destinationTransient, true,
                                  &underlying)) {
    return QRT_ERROR_AS(kReplace, QRTErrorCacheAddFailed, underlying,
                        "Failed to add to cache: %@, url: %@, transient: %d", job.adopted, job.destination,
                        job.destinationTransient);
  }
  return nullptr;
}

// With preserveOldUUID the new content takes the old UUID, on disk first. If
// that write fails the new content goes back where it came from, so that the
// restore can put the old one back; if even that fails the journal stays and
// the start-up recovery writes the UUID.
QRTErrorRef keepOldUUID(ReplaceJob& job, bool* restore) {
  job.adopted = job.newContainer->withUrl(job.destination, job.destinationTransient);
  if (!job.preserveOldUUID) return nullptr;
  job.adopted = job.adopted->withUuid(*job.oldUUID);
  QRTErrorRef writeError;
  if (job.adopted->writeMetadataToDiskWithError(&writeError)) return nullptr;
  QRTErrorRef moveError;
  if (!QRTFileManager::defaultManager().moveItemAtURL(job.destination, job.newURL, &moveError)) {
    QRTLogAs(kLogError, kReplace, "Failed to keep UUID %@ at %@ (%@) nor move the new content back: %@", job.oldUUID,
             job.destination, writeError, moveError);
    job.leftForRecovery = true;
    return QRT_ERROR_AS(kReplace, QRTErrorReplaceJournalFailed, moveError, "Failed to recover replace move: %@ to %@",
                        job.destination, job.newURL);
  }
  *restore = true;
  return writeError;
}

// The moves and the cache swap. *restore tells whether the failing step left
// the old container aside with nothing in its place.
QRTErrorRef swapContainers(ReplaceJob& job, bool* restore) {
  QRTFileManager& files = QRTFileManager::defaultManager();
  QRTErrorRef underlying;
  if (job.oldContainer) {
    if (!files.moveItemAtURL(job.oldURL, job.staging, &underlying)) {
      return QRT_ERROR_AS(kReplace, QRTErrorMoveToStagingFailed, underlying, "Failed to move old %@ to staging %@",
                          job.oldURL, job.staging);
    }
    QRT_CRASH_POINT("replace-after-stage");
    *restore = true;
    if (!QRTContainerCache::sharedInstance().removeContainerForUser(job.userIdOld, job.classOld, job.identifierOld,
                                                                    job.oldContainer->transient(), &underlying)) {
      return QRT_ERROR_AS(kReplace, QRTErrorCacheRemoveFailed, underlying,
                          "Failed to remove from cache id: %@, class: %ld, transient: %d", job.identifierOld,
                          static_cast<long>(job.classOld), job.oldContainer->transient());
    }
    job.oldLeftCache = true;
    QRT_CRASH_POINT("replace-after-cache-remove");
    if (QRTIsBundleClass(job.classOld)) {
      QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance();
      if (mapping &&
          !mapping->invalidateCodeSigningInfoForIdentifierAndItsChildren(job.oldContainer->identifier(), &underlying)) {
        QRTLogAs(kLogError, kReplace, "Failed to invalidate code signing info for %@", job.identifierOld);
        return underlying;
      }
    }
  }
  if (!files.moveItemAtURL(job.newURL, job.destination, &underlying)) {
    return QRT_ERROR_AS(kReplace, QRTErrorReplaceFailed, underlying, "Failed to replace: %@ with: %@ at: %@",
                        pathOrNil(job.oldURL), job.newURL, job.destination);
  }
  *restore = false;
  QRT_CRASH_POINT("replace-after-move-new");
  if (QRTErrorRef error = keepOldUUID(job, restore)) return error;
  QRT_CRASH_POINT("replace-after-keep-uuid");
  return adoptNewContainer(job);
}

// The old container was moved aside and the new one never arrived: its place
// and the destination are both empty. Only then does staging go back.
// Returns false when the move back failed, with error 35; *moved, when
// given, tells whether anything went back.
bool moveStagingBackIfAside(const QRTURL& old, const QRTURL& staging, const QRTURL& destination, const char* function,
                            const char* logFormat, bool* moved, QRTErrorRef* error) {
  QRTFileManager& files = QRTFileManager::defaultManager();
  if (moved) *moved = false;
  if (!files.itemDoesNotExistAtURL(old) || !files.itemDoesNotExistAtURL(destination)) return true;
  // Nothing was moved aside (or it vanished): a move could only fail, every time.
  if (files.itemDoesNotExistAtURL(staging)) return true;
  if (logFormat) QRTLogAs(kLogDebug, function, logFormat, staging, old);
  QRTErrorRef moveError;
  if (!files.moveItemAtURL(staging, old, &moveError)) {
    QRTSetError(error, QRT_ERROR_AS(function, QRTErrorReplaceJournalFailed, moveError,
                                    "Failed to recover replace move: %@ to %@", staging, old));
    return false;
  }
  if (moved) *moved = true;
  return true;
}

// After a failure or an exception. A failed move back keeps the clean-up from
// sending the old content to death row: the journal and staging stay and the
// start-up recovery finishes the restore. (A throw in here ends the process,
// through noexcept.)
void restoreOldContainer(ReplaceJob& job, bool afterException) noexcept {
  if (job.oldURL.empty() || job.destination.empty() || job.staging.empty()) return;
  bool moved = false;
  QRTErrorRef error;
  if (!moveStagingBackIfAside(job.oldURL, job.staging, job.destination, kReplace,
                              afterException ? "Recovering from exception by moving: %@ to %@" : nullptr, &moved,
                              &error)) {
    QRTLogAs(kLogError, kReplace, "Leaving replace journal %@ for the next start: %@", job.journal, error);
    job.leftForRecovery = true;
    return;
  }
  // Re-added so that the restored container does not answer "not found"
  // until the next start rebuilds the cache from disk.
  QRTErrorRef cacheError;
  if (moved && job.oldLeftCache &&
      !QRTContainerCache::sharedInstance().addContainerMetadata(job.oldContainer, job.userIdOld, job.oldURL,
                                                                job.oldContainer->transient(), true, &cacheError)) {
    QRTLogAs(kLogError, kReplace, "Failed to add restored container to cache: %@ : %@", job.oldContainer, cacheError);
  }
}

// Hands staging and journal to death row. Its error, if any, replaces the
// operation's.
QRTErrorRef cleanUpReplace(QRTClientConnection& client, const ReplaceJob& job, bool startDeletionThread) {
  if (job.journal.empty() || job.leftForRecovery) return nullptr;
  QRT_CRASH_POINT("replace-before-cleanup");
  QRTErrorRef result;
  QRTErrorRef underlying;
  if (!client._moveItemAtURLToDeathRow(job.staging, true, false, &underlying)) {
    result =
        QRT_ERROR_AS(kReplace, QRTErrorRemoveItemFailed, underlying, "Failed to remove staging dir: %@", job.staging);
  }
  if (!client._moveItemAtURLToDeathRow(job.journal, false, startDeletionThread, &underlying)) {
    result =
        QRT_ERROR_AS(kReplace, QRTErrorRemoveItemFailed, underlying, "Failed to remove replace file: %@", job.journal);
  }
  QRT_CRASH_POINT("replace-after-cleanup");
  return result;
}

// Whichever content is live at the destination of a UUID-preserving replace
// carries the preserved UUID. A failure keeps the journal for the next start.
bool restorePreservedUUID(const QRTURL& destination, const QRTUUID& uuid, QRTErrorRef* error) {
  if (QRTFileManager::defaultManager().itemDoesNotExistAtURL(
          destination.URLByAppendingPathComponent(QRTMetadataFileName))) {
    return true;
  }
  QRTErrorRef underlying;
  if (QRTMetadata::rewriteUUIDAtUrl(destination, uuid, &underlying)) return true;
  QRTSetError(error, QRT_ERROR_AS(kRecover, QRTErrorReplaceJournalFailed, underlying,
                                  "Failed to restore preserved UUID %@ at %@", uuid, destination));
  return false;
}

plist::Dictionary journalDescription(const std::map<std::string, QRTURL>& info) {
  plist::Dictionary paths;
  for (const auto& [key, url] : info) paths[key] = url.path();
  return paths;
}

}  // namespace

void QRTClientConnection::replaceContainer(const std::optional<QRTUUID>& replaceContainer,
                                           const std::optional<QRTUUID>& withContainer, uint32_t userIdOld,
                                           uint32_t userIdNew, const std::optional<std::string>& identifierOld,
                                           const std::optional<std::string>& identifierNew, uint64_t containerClassOld,
                                           uint64_t containerClassNew, bool preserveOldUUID, bool startDeletionThread,
                                           uint64_t* withError) {
  ReplaceJob job{.oldUUID = replaceContainer,
                 .newUUID = withContainer,
                 .userIdOld = userIdOld,
                 .userIdNew = userIdNew,
                 .identifierOld = identifierOld,
                 .identifierNew = identifierNew,
                 .classOld = containerClassOld,
                 .classNew = containerClassNew,
                 .preserveOldUUID = preserveOldUUID};
  QRTErrorRef error = checkReplaceArguments(job);
  if (error) {
    reportCode(error, withError);
    return;
  }
  QRTAllIdentifiersLock lock(true);
  bool restore = false;
  try {
    error = locateContainers(job);
    if (!error && job.oldUUID) {
      QRTGlobalConfiguration& configuration = QRTGlobalConfiguration::sharedInstance();
      const std::string name = QRTUUID::random().UUIDString();
      job.journal = configuration.replaceDirectory().URLByAppendingPathComponent(QRTFormat("%@.plist", name));
      // Beside the old container, so that it is only ever renamed; a
      // replace without an old container needs no staging.
      auto stagingDirectory = job.oldContainer ? configuration.stagingDirectoryForURL(job.oldURL)
                                               : std::optional<QRTURL>(configuration.stagingDirectory());
      if (!stagingDirectory) {
        error = QRT_ERROR_AS(kReplace, QRTErrorMoveToStagingFailed, nullptr, "No staging directory for %@", job.oldURL);
      } else if (job.staging = stagingDirectory->URLByAppendingPathComponent(name, true);
                 !_writeToDiskReplaceAt(job.journal, job.oldURL, job.newURL, job.staging, job.destination,
                                        job.preserveOldUUID ? job.oldUUID : std::nullopt, &error)) {
        QRTLog(kLogError, "Failed to write replace file: %@", error);
      } else {
        QRT_CRASH_POINT("replace-after-journal");
        error = swapContainers(job, &restore);
      }
    } else if (!error) {
      error = swapContainers(job, &restore);
    }
  } catch (...) {
    error = QRT_EXCEPTION_ERROR();
    restoreOldContainer(job, true);
    restore = false;
  }
  try {
    if (restore) restoreOldContainer(job, false);
    if (QRTErrorRef cleanupError = cleanUpReplace(*this, job, startDeletionThread)) error = cleanupError;
  } catch (...) { error = QRT_EXCEPTION_ERROR(); }
  reportCode(error, withError);
}

bool QRTClientConnection::_writeToDiskReplaceAt(const QRTURL& replaceURL, const QRTURL& old, const QRTURL& withNew,
                                                const QRTURL& usingStaging, const QRTURL& toDestination,
                                                const std::optional<QRTUUID>& preservedUUID, QRTErrorRef* error) {
  if (old.empty() || withNew.empty() || usingStaging.empty() || toDestination.empty()) {
    QRTSetError(error, QRT_ERROR(QRTErrorInvalidReplaceInfo, nullptr, true,
                                 "Invalid Replace File Info: old: %@, new: %@, staging: %@, dest: %@", pathOrNil(old),
                                 pathOrNil(withNew), pathOrNil(usingStaging), pathOrNil(toDestination)));
    return false;
  }
  plist::Dictionary journal{{kOldURLKey, old.path()},
                            {kNewURLKey, withNew.path()},
                            {kStagingURLKey, usingStaging.path()},
                            {kDestURLKey, toDestination.path()}};
  if (preservedUUID) journal[kPreservedUUIDKey] = preservedUUID->UUIDString();
  QRTErrorRef writeError;
  if (!QRT_writeToURL(journal, replaceURL, QRTWriteAtomic | QRTWriteFileProtectionNone, &writeError)) {
    QRTSetError(error, QRT_ERROR(QRTErrorWriteFailed, writeError, true, "Failed to write replace dictionary to URL %@",
                                 replaceURL));
    return false;
  }
  return true;
}

std::optional<std::map<std::string, QRTURL>> QRTClientConnection::_readAndValidateReplaceFileAtUrl(
    const QRTURL& url, std::optional<QRTUUID>* preservedUUID, QRTErrorRef* error) {
  QRTErrorRef readError;
  std::optional<plist::Dictionary> journal = QRT_dictionaryWithContentsOfURL(url, &readError);
  if (!journal) {
    QRTSetError(error,
                QRT_ERROR(QRTErrorReplaceJournalFailed, readError, true, "Failed to read replace file at URL %@", url));
    return std::nullopt;
  }
  std::map<std::string, QRTURL> urls;
  for (const char* key : kJournalKeys) {
    const plist::Value* value = plist::find(*journal, key);
    const std::string* path = value ? value->stringIf() : nullptr;
    // Relative paths would resolve against whatever directory the daemon runs in.
    if (!path || path->empty() || path->front() != '/') {
      QRTSetError(error, QRT_ERROR(QRTErrorReplaceJournalFailed, nullptr, true,
                                   "Invalid replace data: Old: %@, New: %@, Staging: %@, Dest: %@",
                                   valueOrNil(*journal, kOldURLKey), valueOrNil(*journal, kNewURLKey),
                                   valueOrNil(*journal, kStagingURLKey), valueOrNil(*journal, kDestURLKey)));
      return std::nullopt;
    }
    urls[key] = QRTURL::fileURL(*path, true);
  }
  *preservedUUID = std::nullopt;
  if (const plist::Value* value = plist::find(*journal, kPreservedUUIDKey)) {
    const std::string* text = value->stringIf();
    *preservedUUID = text ? QRTUUID::fromString(*text) : std::nullopt;
    if (!*preservedUUID) {
      QRTSetError(error, QRT_ERROR(QRTErrorReplaceJournalFailed, nullptr, true, "Invalid preserved UUID: %@ in %@",
                                   *value, url));
      return std::nullopt;
    }
  }
  return urls;
}

bool QRTClientConnection::_recoverFromReplaceOperationsWithError(QRTErrorRef* error) {
  try {
    QRTURL replaceDirectory = QRTGlobalConfiguration::sharedInstance().replaceDirectory();
    QRTErrorRef listError;
    auto journals = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(replaceDirectory, &listError);
    if (!journals) {
      if (!hasCode(listError, QRTPOSIXErrorDomain, ENOENT)) {
        QRTLog(kLogError, "Failed to get items at replace URL %@ : %@", replaceDirectory, listError);
      }
      return true;
    }
    for (const QRTURL& journalURL : *journals) {
      // An unreadable or invalid journal is not acted on, only removed.
      std::optional<QRTUUID> preservedUUID;
      auto info = _readAndValidateReplaceFileAtUrl(journalURL, &preservedUUID, nullptr);
      if (info) {
        QRTLog(kLogDebug, "Doing a replace of %@ with info: %@", journalURL, plist::Value(journalDescription(*info)));
        if (!moveStagingBackIfAside(info->at(kOldURLKey), info->at(kStagingURLKey), info->at(kDestURLKey), kRecover,
                                    "Recovering from failed replace by moving: %@ to %@", nullptr, error) ||
            (preservedUUID && !restorePreservedUUID(info->at(kDestURLKey), *preservedUUID, error))) {
          return false;
        }
      }
      QRTErrorRef removeError;
      if (!_moveItemAtURLToDeathRow(journalURL, false, false, &removeError)) {
        QRTSetError(error, QRT_ERROR(QRTErrorRemoveItemFailed, removeError, true, "Failed to remove replace file at %@",
                                     journalURL));
        return false;
      }
    }
    return true;
  } catch (...) {
    QRTSetError(error, QRT_EXCEPTION_ERROR());
    return false;
  }
}
