#include "Daemon/store/QRTClientConnection.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <map>
#include <mutex>
#include <iterator>

#include "base/QRTUUID.h"
#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/QRTCrashPoint.h"
#include "Daemon/QRTProcessWide.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTLocks.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTWhitelist.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"
#include "Daemon/store/QRTClientConnectionInternal.h"

bool QRTClientConnection::_removeItemOrMoveToTempAtURL(const QRTURL& url, QRTErrorRef* error) {
  QRTFileManager& files = QRTFileManager::defaultManager();
  QRTErrorRef removeError;
  if (files.removeItemAtURL(url, &removeError)) return true;
  if (removeError->domain() == QRTPOSIXErrorDomain && removeError->code() == ENOENT) return true;
  QRTLog(platform::kLogDebug, "Couldn't remove, so moving item to /tmp: %@ : %@", url, removeError);
  QRTURL scratch = QRTURL::fileURL(platform::hostPath("/tmp"), true);
  QRTErrorRef moveError;
  if (files.moveItemAtURL(url, scratch.URLByAppendingPathComponent(url.lastPathComponent(), url.isDirectory()),
                          &moveError)) {
    return true;
  }
  QRTSetError(error,
              QRT_ERROR(QRTErrorMoveAsideFailed, moveError, true, "Failed to move dir: %@ to: %@", url, scratch));
  return false;
}

namespace {
// A pass lists death row while holding this, and a hand-over holds it from
// making its holding directory until the item is inside: a pass never sees,
// and so never removes, a holding directory that is still empty on its way
// to receiving an item.
std::mutex gDeathRowHandOverLock;
}  // namespace

bool QRTClientConnection::_moveItemAtURLToDeathRow(const QRTURL& url, bool isDir, bool startDeletionThread,
                                                   QRTErrorRef* error) {
  QRTFileManager& files = QRTFileManager::defaultManager();
  QRTErrorRef underlying;
  {
    std::optional<QRTURL> deathRow = QRTGlobalConfiguration::sharedInstance().deathrowDirectoryForURL(url);
    if (!deathRow) {
      QRTSetError(error,
                  QRT_ERROR(QRTErrorDeathRowFailed, nullptr, true, "No death row on the file system of %@", url));
      return false;
    }
    std::lock_guard<std::mutex> handOver(gDeathRowHandOverLock);
    std::optional<QRTURL> holding = files.createTemporaryDirectoryInDirectoryURL(*deathRow, &underlying);
    if (!holding) {
      QRTSetError(error,
                  QRT_ERROR(QRTErrorDeathRowFailed, underlying, true, "Failed to create unique directory at: %@", url));
      return false;
    }
    QRT_PAUSE_POINT("deathrow-hand-over");
    QRTURL target = holding->URLByAppendingPathComponent(url.lastPathComponent(), isDir);
    if (!files.moveItemAtURL(url, target, &underlying)) {
      // Only a missing source means there was nothing to hand over; a
      // missing destination leaves the item where it was.
      if (hasCode(underlying, QRTPOSIXErrorDomain, ENOENT) && files.itemDoesNotExistAtURL(url)) return true;
      QRTSetError(
          error, QRT_ERROR(QRTErrorDeathRowFailed, underlying, true, "Failed to move item at: %@ to: %@", url, target));
      return false;
    }
  }
  if (startDeletionThread) deleteContainersOnDeathRowWithCompletion(nullptr);
  return true;
}

uint64_t QRTClientConnection::_runDeathRowPass() {
  uint64_t result = QRTErrorNone;
  for (const QRTURL& deathRow : QRTGlobalConfiguration::sharedInstance().allDeathrowDirectories()) {
    QRTErrorRef listError;
    std::optional<std::vector<QRTURL>> items;
    {
      std::lock_guard<std::mutex> handOver(gDeathRowHandOverLock);
      items = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(deathRow, &listError);
    }
    if (!items) {
      if (listError->domain() == QRTPOSIXErrorDomain && listError->code() == ENOENT) continue;
      result = QRT_ERROR(QRTErrorDeleteFailed, listError, true, "Failed to get items for deletion: %@ : %@", deathRow,
                         listError)
                   ->resultCode();
      continue;
    }
    for (const QRTURL& item : *items) {
      QRTErrorRef itemError;
      if (!_removeItemOrMoveToTempAtURL(item, &itemError)) {
        result = QRT_ERROR(QRTErrorDestroyFailed, itemError, true, "Failed to destroy item at: %@", item)->resultCode();
      }
    }
  }
  return result;
}

void QRTClientConnection::deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion) {
  // The pass needs nothing of the requesting client; it runs as the daemon.
  run_async_with_transaction(QRTDeathRowQueue(), [completion = std::move(completion)] {
    uint64_t result;
    try {
      result = sharedClientConnection()._runDeathRowPass();
    } catch (...) { result = QRT_EXCEPTION_ERROR()->resultCode(); }
    if (completion) completion(result);
  });
}

// ---- Removal ----

void QRTClientConnection::stageForDeleteContainersWithUsers(const std::vector<uint32_t>& users,
                                                            const std::vector<std::optional<QRTUUID>>& UUIDs,
                                                            const std::vector<std::optional<std::string>>& identifiers,
                                                            const std::vector<std::optional<uint64_t>>& classes,
                                                            bool useLocking, uint64_t* withError) {
  if (UUIDs.size() != classes.size() || UUIDs.size() != identifiers.size()) {
    reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                         "Can't act on an invalid input: UUIDString count: %ld, class count: %ld, ID count: %ld",
                         static_cast<long>(UUIDs.size()), static_cast<long>(classes.size()),
                         static_cast<long>(identifiers.size())),
               withError);
    return;
  }
  QRTFileManager& files = QRTFileManager::defaultManager();
  QRTContainerCache& cache = QRTContainerCache::sharedInstance();
  try {
    QRTAllIdentifiersLock lock(true, useLocking);
    for (size_t i = 0; i < classes.size(); ++i) {
      if (!classes[i]) {
        QRT_ERROR(QRTErrorInvalidParameter, nullptr, true, "Can't act on an invalid object: class: %@", nullptr);
        continue;
      }
      const uint64_t containerClass = *classes[i];
      const uint32_t userId = users.at(i);  // a short user list ends in the exception path
      if (!UUIDs[i] || !identifiers[i] || containerClass < 1 || containerClass > 13) {
        QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                  "Can't act on an invalid object: userId: %u, UUID: %@, ID: %@, Class: %ld", userId, UUIDs[i],
                  identifiers[i], static_cast<long>(containerClass));
        continue;
      }
      auto metadata = cache.containerForUser(userId, containerClass, identifiers[i], UUIDs[i]->UUIDString());
      if (!metadata) continue;
      auto deathRow = QRTGlobalConfiguration::sharedInstance().deathrowDirectoryForURL(metadata->url());
      if (!deathRow) {
        QRT_ERROR(QRTErrorDeleteFailed, nullptr, true, "No death row on the file system of %@", metadata->url());
        continue;
      }
      QRTURL target = deathRow->URLByAppendingPathComponent(metadata->url().lastPathComponent(), true);
      // Dropped whether or not the move succeeds: a bundle on its way out grants nothing.
      if (QRTIsBundleClass(containerClass)) {
        if (QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance()) {
          mapping->removeCodeSigningDictionariesForIdentifierAndItsChildren(*identifiers[i]);
        }
      }
      QRTErrorRef moveError;
      if (!files.moveItemAtURL(metadata->url(), target, &moveError)) {
        QRTLog(platform::kLogDebug, "Couldn't stage for deletion from %@ to %@: %@", metadata->url(), target,
               moveError);
        QRTErrorRef removeError;
        if (!files.removeItemAtURL(metadata->url(), &removeError)) {
          QRT_ERROR(QRTErrorDeleteFailed, removeError, true, "Failed to delete container at %@: %@", metadata->url(),
                    removeError);
          continue;
        }
      }
      QRT_CRASH_POINT("delete-after-stage");
      QRTErrorRef cacheError;
      if (!cache.removeContainerForUser(userId, containerClass, metadata->identifier(), metadata->transient(),
                                        &cacheError)) {
        reportCode(QRT_ERROR(QRTErrorCacheRemoveFailed, cacheError, true,
                             "Failed to remove from cache id: %@, class: %ld, transient: %d", metadata->identifier(),
                             static_cast<long>(containerClass), metadata->transient()),
                   withError);
        return;
      }
    }
  } catch (...) { reportCode(QRT_EXCEPTION_ERROR(), withError); }
}

void QRTClientConnection::deleteContainerForUser(uint32_t userId, const std::optional<std::string>& withIdentifier,
                                                 uint64_t containerClass, bool transient, uint64_t* withError) {
  try {
    uint64_t code = QRTErrorNone;
    auto metadata = createOrLookupContainerForUser({userId, containerClass, withIdentifier, transient},
                                                   QRTCreateMode::LookupOnly, QRTLocking::TakeLocks, &code);
    if (!metadata) {
      QRTLog(platform::kLogError,
             "Failed to lookup existing container to delete-identifier: %@, class: %ld, transient: %d", withIdentifier,
             static_cast<long>(containerClass), transient);
      if (withError) *withError = code;
      return;
    }
    stageForDeleteContainersWithUsers({metadata->uid()}, {metadata->uuid()}, {metadata->identifier()},
                                      {metadata->containerClass()}, true, withError);
  } catch (...) { reportCode(QRT_EXCEPTION_ERROR(), withError); }
}

void QRTClientConnection::deleteDataContainerContentForUser(uint32_t userId,
                                                            const std::optional<std::string>& identifier,
                                                            uint64_t containerClass, uint64_t* withError) {
  auto fail = [withError](uint64_t code) {
    if (withError) *withError = code;
  };
  if (!identifier) {
    QRTLog(platform::kLogError, "Can't wipe container with nil identifier: %@, userId: %u", identifier, userId);
    return fail(QRTErrorNilIdentifier);
  }
  if (!QRTIsPerUserClass(containerClass)) {
    QRTLog(platform::kLogError, "Can't wipe container non-data container of type: %llu, identifier: %@, userId: %u",
           static_cast<unsigned long long>(containerClass), identifier, userId);
    return fail(QRTErrorInvalidParameter);
  }
  if (!allowOtherIdLookup_) {
    if (containerClass != QRTClassAddonData) {
      QRTLog(platform::kLogError, "Can't wipe container with of type: %llu, identifier: %@, userId: %u",
             static_cast<unsigned long long>(containerClass), identifier, userId);
      return fail(QRTErrorInvalidParameter);
    }
    const auto& entitled = entitledWipeIdentifiers_.value_or(std::vector<std::string>{});
    if (std::find(entitled.begin(), entitled.end(), *identifier) == entitled.end()) {
      QRTLog(platform::kLogError, "Not entitled to wipe container with identifier: %@", identifier);
      return fail(QRTErrorNotEntitled);
    }
  }
  try {
    uint64_t code = QRTErrorNone;
    auto existing = createOrLookupContainerForUser({userId, containerClass, identifier}, QRTCreateMode::LookupOnly,
                                                   QRTLocking::TakeLocks, &code);
    if (!existing) {
      QRTLog(platform::kLogError, "Failed to lookup existing container to wipe-identifier: %@", identifier);
      return fail(code);
    }
    auto fresh = createOrLookupContainerForUser({userId, containerClass, identifier, true},
                                                QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, &code);
    if (!fresh) {
      QRTLog(platform::kLogError, "Failed to create transient container for wipe-identifier: %@", identifier);
      return fail(code);
    }
    replaceContainer(existing->uuid(), fresh->uuid(), userId, userId, identifier, identifier, containerClass,
                     containerClass, true, true, &code);
    if (code != QRTErrorNone) {
      QRTLog(platform::kLogError, "Failed replace operation during delete all content");
      return fail(code);
    }
  } catch (...) { reportCode(QRT_EXCEPTION_ERROR(), withError); }
}
