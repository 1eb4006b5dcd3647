#include "Daemon/QRTClientConnection.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <map>
#include <iterator>

#include "base/QRTUUID.h"
#include "Daemon/QRTContainerCache.h"
#include "Daemon/QRTContentClass.h"
#include "Daemon/QRTCrashPoint.h"
#include "Daemon/QRTDaemon.h"
#include "Daemon/QRTFileManager.h"
#include "Daemon/QRTGlobalConfiguration.h"
#include "Daemon/QRTLocks.h"
#include "Daemon/QRTMetadata.h"
#include "Daemon/QRTWhitelist.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

QRTClientConnection::QRTClientConnection(std::optional<std::string> bundleId, uint32_t clientUserId,
                                         bool allowOtherIdLookup,
                                         std::optional<std::vector<std::string>> entitledWipeIdentifiers)
    : clientBundleIdentifier_(std::move(bundleId)),
      clientUserId_(clientUserId),
      allowOtherIdLookup_(allowOtherIdLookup),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)) {}

QRTClientConnection::QRTClientConnection(std::optional<std::string> bundleId, bool allowOtherIdLookup)
    : QRTClientConnection(std::move(bundleId), 0, allowOtherIdLookup, std::nullopt) {}

QRTClientConnection& QRTClientConnection::sharedClientConnection() {
  static QRTClientConnection* shared = new QRTClientConnection("com.norvane.quarterd.internal", true);
  return *shared;
}

// The first-boot work (upgrade migration, system container installation,
// transient and orphan clean-up) joins with those subsystems.
void QRTClientConnection::rebootQuarterSetup() {}
void QRTClientConnection::rebootQuarterCleanup() {}

namespace {
// A replace whose old container could not be moved back out of staging keeps
// its journal; staging must then survive until a later start completes it.
bool gReplaceRecoveryIncomplete = false;
}  // namespace

void QRTClientConnection::quarterSetup() {
  // Before quarterCleanup empties staging: a rollback moves a container back out of it.
  QRTErrorRef error;
  if (!_recoverFromReplaceOperationsWithError(&error)) {
    QRTLog(platform::kLogError, "Failed recovering from replace operations: %@", error);
    gReplaceRecoveryIncomplete = true;
  }
}

void QRTClientConnection::quarterCleanup() {
  if (gReplaceRecoveryIncomplete) {
    deleteContainersOnDeathRowWithCompletion(nullptr);
    return;
  }
  QRTURL staging = QRTGlobalConfiguration::sharedInstance().stagingDirectory();
  QRTErrorRef error;
  auto items = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(staging, &error);
  if (!items && !(error->domain() == QRTPOSIXErrorDomain && error->code() == ENOENT)) {
    QRTLog(platform::kLogError, "Failed to get items at staging URL%@ : %@", staging, error);
  }
  for (const QRTURL& item : items.value_or(std::vector<QRTURL>{})) {
    _moveItemAtURLToDeathRow(item, true, false, nullptr);
  }
  deleteContainersOnDeathRowWithCompletion(nullptr);
}

namespace {

// The code-signing mapping will say which programs hold a system container;
// until it exists no program is known to hold one.
bool codeSigningGrantsSystemContainer(const std::string&) { return false; }

// The request layer sees only the code of an operation's error.
void reportCode(const QRTErrorRef& error, uint64_t* withError) {
  if (error && withError) *withError = error->resultCode();
}

constexpr const char* kDataSubDirectories[] = {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"};
constexpr const char* kGroupSubDirectories[] = {"Library", "Library/Caches"};

// Owner of the sub-directories of system containers: the unprivileged nobody id.
constexpr uint32_t kNobodyId = 4294967294u;

}  // namespace

bool QRTClientConnection::_createDefaultDirectory(const QRTURL& url, mode_t mode, uint32_t owner,
                                                  QRTErrorRef* error) {
  return QRTFileManager::defaultManager().createDirectoryAtURL(url, true, mode, owner, -1, error);
}

bool QRTClientConnection::_createTopLevelContainerDirectory(const QRTURL& url, uint64_t containerClass,
                                                            uint32_t owner, QRTErrorRef* error) {
  uint32_t directoryOwner = owner;
  if (QRTIsBundleClass(containerClass)) directoryOwner = QRTInstallerUserId;
  if (QRTIsSystemClass(containerClass)) directoryOwner = 0;
  return QRTFileManager::defaultManager().createDirectoryAtURL(url, true, 0755, directoryOwner, 0, error);
}

bool QRTClientConnection::_createSubDirectories(const QRTURL& url, uint32_t userId, uint64_t containerClass,
                                                QRTErrorRef* error) {
  const char* const* begin = nullptr;
  size_t count = 0;
  if (containerClass == 7 || containerClass == 13) {
    begin = kGroupSubDirectories;
    count = std::size(kGroupSubDirectories);
  } else if (QRTIsPerUserClass(containerClass) || containerClass == 12) {
    begin = kDataSubDirectories;
    count = std::size(kDataSubDirectories);
  }
  const bool system = QRTIsSystemClass(containerClass);
  const mode_t mode = system ? 0000 : 0755;
  const uint32_t owner = system ? kNobodyId : userId;
  for (size_t i = 0; i < count; ++i) {
    QRTErrorRef underlying;
    if (!_createDefaultDirectory(url.URLByAppendingPathComponent(begin[i], true), mode, owner, &underlying)) {
      QRTSetError(error, QRT_ERROR(QRTErrorCreateSubdirectoryFailed, underlying, true,
                                   "Failed to create sub-dir at %@%@", url, std::string("/") + begin[i]));
      return false;
    }
  }
  return true;
}

std::shared_ptr<QRTMetadata> QRTClientConnection::_buildInStaging(const QRTURL& staging, uint32_t userId,
                                                                  const std::string& identifier,
                                                                  uint64_t containerClass, QRTErrorRef* error) {
  QRTErrorRef underlying;
  if (!_createTopLevelContainerDirectory(staging, containerClass, userId, &underlying)) {
    QRTSetError(error, QRT_ERROR(QRTErrorCreateStagingFailed, underlying, true, "Failed to create staging dir at %@ : %@",
                                 staging, underlying));
    return nullptr;
  }
  auto metadata = std::make_shared<QRTMetadata>(userId, QRTUUID::random(), containerClass, identifier, std::nullopt,
                                                staging, std::nullopt);
  if (!metadata->writeMetadataToDiskWithError(error)) return nullptr;
  if (QRTIsSystemClass(containerClass) &&
      !QRTFileManager::defaultManager().setTopLevelSystemContainerACLAtURL(staging, error)) {
    return nullptr;
  }
  if (!_createSubDirectories(staging, userId, containerClass, error)) return nullptr;
  return metadata;
}

std::shared_ptr<QRTMetadata> QRTClientConnection::_createNewContainer(uint32_t userId, const std::string& identifier,
                                                                      uint64_t containerClass, bool transient,
                                                                      QRTErrorRef* error) {
  QRTGlobalConfiguration& configuration = QRTGlobalConfiguration::sharedInstance();
  const std::string directoryName = QRTUUID::random().UUIDString();
  const QRTURL staging = configuration.stagingDirectory().URLByAppendingPathComponent(directoryName, true);

  std::shared_ptr<QRTMetadata> metadata = _buildInStaging(staging, userId, identifier, containerClass, error);
  if (metadata) {
    std::optional<QRTURL> classDirectory =
        configuration.containerDirectoryURLForUser(userId, containerClass, transient);
    std::string finalName = directoryName;
    if (auto wellKnown = QRTWhitelist::sharedWhitelist().wellknownContainerForId(identifier, containerClass)) {
      finalName = *wellKnown;
    }
    QRTURL finalURL = classDirectory ? classDirectory->URLByAppendingPathComponent(finalName, true) : QRTURL();
    QRTErrorRef moveError;
    if (!classDirectory || !QRTFileManager::defaultManager().moveItemAtURL(staging, finalURL, &moveError)) {
      QRTSetError(error, QRT_ERROR(QRTErrorMoveStagingToLiveFailed, moveError, true,
                                   "Failed to move staging dir: %@ to live dir: %@", staging, finalURL));
      metadata = nullptr;
    } else {
      metadata->setUrl(finalURL);
      metadata->setExisted(false);
      metadata->setTransient(transient);
      QRTErrorRef cacheError;
      if (!QRTContainerCache::sharedInstance().addContainerMetadata(metadata, userId, finalURL, transient, true,
                                                                    &cacheError)) {
        QRTSetError(error, QRT_ERROR(QRTErrorCacheAddFailed, cacheError, true,
                                     "Failed to add to cache for %u : %@, url: %@, transient: %d", userId, metadata,
                                     finalURL, transient));
        return nullptr;  // the container is complete on disk; the cache finds it after a restart
      }
      return metadata;
    }
  }
  // Nothing half-made stays behind: the staging directory goes to death row.
  QRTErrorRef cleanupError;
  if (!_moveItemAtURLToDeathRow(staging, true, true, &cleanupError)) {
    QRTSetError(error, QRT_ERROR(QRTErrorRemoveStagingFailed, cleanupError, true, "Failed to remove staging dir: %@",
                                 staging));
  }
  return nullptr;
}

std::shared_ptr<QRTMetadata> QRTClientConnection::createOrLookupContainerForUser(
    uint32_t userId, const std::optional<std::string>& identifier, bool createIfNecessary, uint64_t containerClass,
    bool transient, bool useLocking, uint64_t* withError) {
  if (!identifier || containerClass < 1 || containerClass > 13) {
    reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                         "Can't act on an invalid object: userId: %u, ID: %@, class: %ld", userId, identifier,
                         static_cast<long>(containerClass)),
               withError);
    return nullptr;
  }
  if (!user_id_valid_for_class(containerClass, userId)) {
    reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true, "Invalid userId %u for class %ld, ID: %@", userId,
                         static_cast<long>(containerClass), identifier),
               withError);
    return nullptr;
  }
  const bool foreign = identifier != clientBundleIdentifier_;
  if (foreign && !allowOtherIdLookup_ && !((containerClass == 7 || containerClass == 13) && allowGroupIdLookup_) &&
      platform::deviceIsInternalBuild()) {
    QRTLog(platform::kLogDebug,
           "%@ trying to retrieve container class %ld for identifier: %@. WARNING: Soon you will need an entitlement "
           "to do this. File a Bugline in \"QuarterKit | all\"",
           clientBundleIdentifier_, static_cast<long>(containerClass), identifier);
  }
  if (containerClass == 12 && !allowOtherIdLookup_ &&
      (!codeSigningGrantsSystemContainer(*identifier) || foreign)) {
    reportCode(QRT_ERROR(QRTErrorNotEntitled, nullptr, true, "%@ not entitled for system container with identifier %@",
                         clientBundleIdentifier_, identifier),
               withError);
    return nullptr;
  }

  QRTErrorRef error;
  std::shared_ptr<QRTMetadata> result;
  try {
    result = _lookupOrCreate(userId, *identifier, createIfNecessary, containerClass, transient, useLocking, &error);
  } catch (...) {
    error = QRT_EXCEPTION_ERROR();
  }
  if (!result) reportCode(error, withError);
  return result;
}

std::shared_ptr<QRTMetadata> QRTClientConnection::_lookupOrCreate(uint32_t userId, const std::string& identifier,
                                                                  bool createIfNecessary, uint64_t containerClass,
                                                                  bool transient, bool useLocking, QRTErrorRef* error) {
  QRTAllIdentifiersLock lock(true, useLocking);
  QRTErrorRef lookupError;
  std::shared_ptr<QRTMetadata> found =
      QRTContainerCache::sharedInstance().containerForUser(userId, containerClass, identifier, transient, &lookupError);
  if (found && !transient) {
    found->setExisted(true);
    return found;
  }
  if (found) {
    // A transient container is never reused.
    QRTErrorRef moveError;
    if (!_moveItemAtURLToDeathRow(found->url(), true, true, &moveError)) {
      QRTSetError(error, QRT_ERROR(QRTErrorRemoveTransientFailed, moveError, true,
                                   "Failed to remove transient container at %@", found->url()));
      return nullptr;
    }
    // Forget it too, so that a look-up without creation answers "not found"
    // rather than finding a container that is gone.
    QRTContainerCache::sharedInstance().removeContainerForUser(userId, containerClass, identifier, true, nullptr);
  } else if (!(lookupError->domain() == QRTErrorDomain && lookupError->code() == QRTErrorNotFound)) {
    QRTSetError(error, lookupError);
    return nullptr;
  }
  if (!createIfNecessary) {
    QRTSetError(error, QRT_ERROR(QRTErrorNotFound, nullptr, false, "Container with identifier: \"%@\" Not Found",
                                 identifier));
    return nullptr;
  }
  return _createNewContainer(userId, identifier, containerClass, transient, error);
}

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
  QRTSetError(error, QRT_ERROR(QRTErrorMoveAsideFailed, moveError, true, "Failed to move dir: %@ to: %@", url, scratch));
  return false;
}

bool QRTClientConnection::_moveItemAtURLToDeathRow(const QRTURL& url, bool isDir, bool startDeletionThread,
                                                   QRTErrorRef* error) {
  QRTFileManager& files = QRTFileManager::defaultManager();
  QRTErrorRef underlying;
  std::optional<QRTURL> holding = files.createTemporaryDirectoryInDirectoryURL(
      QRTGlobalConfiguration::sharedInstance().deathrowDirectory(), &underlying);
  if (!holding) {
    QRTSetError(error, QRT_ERROR(QRTErrorDeathRowFailed, underlying, true, "Failed to create unique directory at: %@",
                                 url));
    return false;
  }
  QRTURL target = holding->URLByAppendingPathComponent(url.lastPathComponent(), isDir);
  if (!files.moveItemAtURL(url, target, &underlying)) {
    if (underlying->domain() == QRTPOSIXErrorDomain && underlying->code() == ENOENT) return true;
    QRTSetError(error, QRT_ERROR(QRTErrorDeathRowFailed, underlying, true, "Failed to move item at: %@ to: %@", url,
                                 target));
    return false;
  }
  if (startDeletionThread) deleteContainersOnDeathRowWithCompletion(nullptr);
  return true;
}

uint64_t QRTClientConnection::_runDeathRowPass() {
  QRTErrorRef listError;
  QRTURL deathRow = QRTGlobalConfiguration::sharedInstance().deathrowDirectory();
  auto items = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(deathRow, &listError);
  if (!items) {
    if (listError->domain() == QRTPOSIXErrorDomain && listError->code() == ENOENT) return QRTErrorNone;
    return QRT_ERROR(QRTErrorDeleteFailed, listError, true, "Failed to get items for deletion: %@ : %@", nullptr,
                     listError)
        ->resultCode();
  }
  uint64_t result = QRTErrorNone;
  for (const QRTURL& item : *items) {
    QRTErrorRef itemError;
    if (!_removeItemOrMoveToTempAtURL(item, &itemError)) {
      result = QRT_ERROR(QRTErrorDestroyFailed, itemError, true, "Failed to destroy item at: %@", item)->resultCode();
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
    } catch (...) {
      result = QRT_EXCEPTION_ERROR()->resultCode();
    }
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
      QRTURL target = QRTGlobalConfiguration::sharedInstance().deathrowDirectory().URLByAppendingPathComponent(
          metadata->url().lastPathComponent(), true);
      // Code-signing information of bundles is dropped here once the
      // code-signing mapping exists.
      QRTErrorRef moveError;
      if (!files.moveItemAtURL(metadata->url(), target, &moveError)) {
        QRTLog(platform::kLogDebug, "Couldn't stage for deletion from %@ to %@: %@", metadata->url(), target, moveError);
        QRTErrorRef removeError;
        if (!files.removeItemAtURL(metadata->url(), &removeError)) {
          QRT_ERROR(QRTErrorDeleteFailed, removeError, true, "Failed to delete container at %@: %@", metadata->url(),
                    removeError);
          continue;
        }
      }
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
  } catch (...) {
    reportCode(QRT_EXCEPTION_ERROR(), withError);
  }
}

void QRTClientConnection::deleteContainerForUser(uint32_t userId, const std::optional<std::string>& withIdentifier,
                                                 uint64_t containerClass, bool transient, uint64_t* withError) {
  try {
    uint64_t code = QRTErrorNone;
    auto metadata =
        createOrLookupContainerForUser(userId, withIdentifier, false, containerClass, transient, true, &code);
    if (!metadata) {
      QRTLog(platform::kLogError, "Failed to lookup existing container to delete-identifier: %@, class: %ld, transient: %d",
             withIdentifier, static_cast<long>(containerClass), transient);
      if (withError) *withError = code;
      return;
    }
    stageForDeleteContainersWithUsers({metadata->uid()}, {metadata->uuid()}, {metadata->identifier()},
                                      {metadata->containerClass()}, true, withError);
  } catch (...) {
    reportCode(QRT_EXCEPTION_ERROR(), withError);
  }
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
    auto existing = createOrLookupContainerForUser(userId, identifier, false, containerClass, false, true, &code);
    if (!existing) {
      QRTLog(platform::kLogError, "Failed to lookup existing container to wipe-identifier: %@", identifier);
      return fail(code);
    }
    auto fresh = createOrLookupContainerForUser(userId, identifier, true, containerClass, true, true, &code);
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
  } catch (...) {
    reportCode(QRT_EXCEPTION_ERROR(), withError);
  }
}

// ---- Queries and info values ----

namespace {

bool validSelector(const char* function, uint32_t userId, const std::optional<QRTUUID>& uuid, uint64_t containerClass,
                   QRTErrorRef* error) {
  if (uuid && containerClass >= 1 && containerClass <= 13) return true;
  QRTSetError(error, QRTCreateError(function, __LINE__, QRTErrorDomain, QRTErrorInvalidParameter, nullptr, nullptr,
                                    true, "Can't act on an invalid object: userId: %u, UUID: %@, Class: %ld", userId,
                                    uuid, static_cast<long>(containerClass)));
  return false;
}

std::shared_ptr<QRTMetadata> lookupByUUID(const char* function, uint32_t userId, const QRTUUID& uuid,
                                          const std::optional<std::string>& identifier, uint64_t containerClass,
                                          QRTErrorRef* error) {
  auto metadata =
      QRTContainerCache::sharedInstance().containerForUser(userId, containerClass, identifier, uuid.UUIDString());
  if (!metadata) {
    QRTSetError(error, QRTCreateError(function, __LINE__, QRTErrorDomain, QRTErrorNotFound, nullptr, nullptr, true,
                                      "No Container with userId: %u UUID: %@, identifier: %@, Class: %ld", userId,
                                      uuid, identifier, static_cast<long>(containerClass)));
  }
  return metadata;
}

}  // namespace

std::optional<std::vector<std::shared_ptr<QRTMetadata>>> QRTClientConnection::containersForUser(uint32_t userId,
                                                                                             uint64_t withClass,
                                                                                             bool transient,
                                                                                             uint64_t* withError) {
  if (withClass < 1 || withClass > 13) {
    reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                         "Can't act on an invalid container-userId: %u, class: %ld", userId,
                         static_cast<long>(withClass)),
               withError);
    return std::nullopt;
  }
  QRTErrorRef error;
  try {
    QRTAllIdentifiersLock lock(false);
    auto list = QRTContainerCache::sharedInstance().allContainersForUser(userId, withClass, transient, &error);
    if (list) return list;
  } catch (...) {
    error = QRT_EXCEPTION_ERROR();
  }
  reportCode(error, withError);
  return std::nullopt;
}

std::shared_ptr<QRTMetadata> QRTClientConnection::metadataForUser(uint32_t userId,
                                                                  const std::optional<QRTUUID>& withUUID,
                                                                  const std::optional<std::string>& identifier,
                                                                  uint64_t containerClass, uint64_t* withError) {
  QRTErrorRef error;
  try {
    if (validSelector(__func__, userId, withUUID, containerClass, &error)) {
      QRTIdentifierLock lock(withUUID->UUIDString(), false);
      if (auto metadata = lookupByUUID(__func__, userId, *withUUID, identifier, containerClass, &error)) {
        return metadata;
      }
    }
  } catch (...) {
    error = QRT_EXCEPTION_ERROR();
  }
  reportCode(error, withError);
  return nullptr;
}

void QRTClientConnection::setInfoValue(const std::optional<plist::Value>& value,
                                       const std::optional<std::string>& forKey, uint32_t userId,
                                       const std::optional<QRTUUID>& uuid,
                                       const std::optional<std::string>& identifier, uint64_t containerClass,
                                       bool useLocking, uint64_t* withError) {
  QRTErrorRef error;
  try {
    if (!validSelector(__func__, userId, uuid, containerClass, &error)) return reportCode(error, withError);
    if (!forKey) {
      return reportCode(
          QRT_ERROR(QRTErrorInvalidArgument, nullptr, true, "Can't set nil or non-TextValue key: %@", forKey),
          withError);
    }
    QRTIdentifierLock lock(uuid->UUIDString(), true, useLocking);
    auto metadata = lookupByUUID(__func__, userId, *uuid, identifier, containerClass, &error);
    if (!metadata) return reportCode(error, withError);
    plist::Dictionary info = metadata->info().value_or(plist::Dictionary{});
    if (value) {
      info[*forKey] = *value;
    } else {
      info.erase(*forKey);
    }
    metadata->setInfo(std::move(info));
    if (!metadata->writeMetadataToDiskWithError(&error)) return reportCode(error, withError);
    QRTErrorRef cacheError;
    if (!QRTContainerCache::sharedInstance().addContainerMetadata(metadata, metadata->uid(), metadata->url(),
                                                                  metadata->transient(), false, &cacheError)) {
      reportCode(QRT_ERROR(QRTErrorCacheAddFailed, cacheError, true, "Failed to add to cache: %@, url: %@, transient: %d",
                           metadata, metadata->url(), metadata->transient()),
                 withError);
    }
  } catch (...) {
    reportCode(QRT_EXCEPTION_ERROR(), withError);
  }
}

std::optional<plist::Value> QRTClientConnection::infoValueForKey(const std::optional<std::string>& key,
                                                                 uint32_t userId, const std::optional<QRTUUID>& uuid,
                                                                 const std::optional<std::string>& identifier,
                                                                 uint64_t containerClass, bool useLocking,
                                                                 uint64_t* withError) {
  QRTErrorRef error;
  try {
    if (!validSelector(__func__, userId, uuid, containerClass, &error)) {
      reportCode(error, withError);
      return std::nullopt;
    }
    if (!key) {
      reportCode(QRT_ERROR(QRTErrorInvalidArgument, nullptr, true, "Can't get nil or non-TextValue key: %@", key),
                 withError);
      return std::nullopt;
    }
    QRTIdentifierLock lock(uuid->UUIDString(), false, useLocking);
    auto metadata = lookupByUUID(__func__, userId, *uuid, identifier, containerClass, &error);
    if (metadata) {
      const auto& info = metadata->info();
      if (const plist::Value* value = info ? plist::find(*info, *key) : nullptr) return *value;
      error = QRT_ERROR(QRTErrorInfoValueNotFound, nullptr, false, "Didn't find info value for key: %@", key);
    }
  } catch (...) {
    error = QRT_EXCEPTION_ERROR();
  }
  reportCode(error, withError);
  return std::nullopt;
}

void QRTClientConnection::recreateDefaultStructureForUser(uint32_t userId, const std::optional<QRTUUID>& withUUID,
                                                          const std::optional<std::string>& identifier,
                                                          uint64_t containerClass, uint64_t* withError) {
  QRTErrorRef error;
  try {
    if (!validSelector(__func__, userId, withUUID, containerClass, &error)) return reportCode(error, withError);
    QRTIdentifierLock lock(withUUID->UUIDString(), true);
    auto metadata = lookupByUUID(__func__, userId, *withUUID, identifier, containerClass, &error);
    if (!metadata || !_createSubDirectories(metadata->url(), metadata->uid(), containerClass, &error)) {
      return reportCode(error, withError);
    }
    if (QRTIsSystemClass(containerClass) &&
        !QRTFileManager::defaultManager().standardizeACLsForSystemContainerAtURL(metadata->url(), &error)) {
      reportCode(error, withError);
    }
  } catch (...) {
    reportCode(QRT_EXCEPTION_ERROR(), withError);
  }
}

std::vector<std::shared_ptr<QRTMetadata>> QRTClientConnection::_containersToRename(
    uint32_t userId, const QRTUUID& uuid, const std::optional<std::string>& identifier, uint64_t containerClass,
    QRTErrorRef* error) {
  std::vector<std::shared_ptr<QRTMetadata>> chosen;
  const bool multiUser = QRTIsPerUserClass(containerClass) && (platform::deviceMultiUserFlags() & 0x80000000u);
  if (!multiUser) {
    if (auto metadata = lookupByUUID("regenerateDirectoryUUIDForUser", userId, uuid, identifier, containerClass,
                                     error)) {
      chosen.push_back(std::move(metadata));
    }
    return chosen;
  }
  // Every user of the device: on this platform, the current mobile user.
  for (uint32_t user : {QRTGlobalConfiguration::sharedInstance().currentMobileUserId()}) {
    auto metadata = QRTContainerCache::sharedInstance().containerForUser(user, containerClass, identifier, false,
                                                                        nullptr);
    if (metadata) {
      chosen.push_back(std::move(metadata));
    } else {
      QRTLog(platform::kLogDebug, "No Container with userId: %u, identifier: %@, Class: %ld", user, identifier,
             static_cast<long>(containerClass));
    }
  }
  if (chosen.empty()) {
    QRTSetError(error, QRT_ERROR(QRTErrorNotFound, nullptr, true, "No Containers found with identifier: %@, Class: %ld",
                                 identifier, static_cast<long>(containerClass)));
  }
  return chosen;
}

void QRTClientConnection::regenerateDirectoryUUIDForUser(uint32_t userId,
                                                         const std::optional<QRTUUID>& withInternalUUID,
                                                         const std::optional<std::string>& identifier,
                                                         uint64_t containerClass, uint64_t* withError) {
  QRTErrorRef error;
  try {
    if (!validSelector(__func__, userId, withInternalUUID, containerClass, &error)) return reportCode(error, withError);
    auto chosen = _containersToRename(userId, *withInternalUUID, identifier, containerClass, &error);
    if (chosen.empty()) return reportCode(error, withError);
    QRTAllIdentifiersLock lock(true);
    for (const auto& metadata : chosen) {
      const QRTURL oldURL = metadata->url();
      if (!QRTUUID::fromString(oldURL.lastPathComponent())) {
        return reportCode(QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                                    "Non-UUID last path component: %@ for identifier: %@, userId: %u, Class: %ld",
                                    oldURL.lastPathComponent(), identifier, metadata->uid(),
                                    static_cast<long>(containerClass)),
                          withError);
      }
      QRTURL newURL = oldURL.URLByDeletingLastPathComponent().URLByAppendingPathComponent(
          QRTUUID::random().UUIDString(), true);
      QRTErrorRef moveError;
      if (!QRTFileManager::defaultManager().moveItemAtURL(oldURL, newURL, &moveError)) {
        return reportCode(QRT_ERROR(QRTErrorMoveToNewUUIDFailed, moveError, true,
                                    "Failed to move dir: %@ to new UUID dir: %@", oldURL, newURL),
                          withError);
      }
      QRTErrorRef cacheError;
      if (!QRTContainerCache::sharedInstance().addContainerMetadata(metadata, metadata->uid(), newURL,
                                                                    metadata->transient(), true, &cacheError)) {
        return reportCode(QRT_ERROR(QRTErrorCacheAddFailed, cacheError, true,
                                    "Failed to add to cache: %@, url: %@, transient: %d", metadata, newURL,
                                    metadata->transient()),
                          withError);
      }
    }
  } catch (...) {
    reportCode(QRT_EXCEPTION_ERROR(), withError);
  }
}

void QRTClientConnection::_regenerateAllSystemContainerPaths() {
  QRTLog(platform::kLogNotice, "Rolling system container directory UUIDs on disk");
  for (uint64_t containerClass : {uint64_t{QRTClassSystemData}, uint64_t{QRTClassSystemGroup}}) {
    QRTErrorRef error;
    auto list = QRTContainerCache::sharedInstance().allContainersForUser(QRTSystemContainerUserId, containerClass,
                                                                        false, false, &error);
    if (!list) {
      QRTLog(platform::kLogError, "Failed to get list of system containers for migration: %@", error);
      continue;
    }
    for (const auto& metadata : *list) {
      const std::string& identifier = metadata->identifier();
      if (QRTWhitelist::sharedWhitelist().containerIdIsWellknown(identifier, containerClass) ||
          identifier == "systemgroup.com.norvane.diagvault") {
        continue;
      }
      uint64_t code = QRTErrorNone;
      regenerateDirectoryUUIDForUser(QRTSystemContainerUserId, metadata->uuid(), identifier, containerClass, &code);
      if (code != QRTErrorNone) {
        QRTLog(platform::kLogError, "Failed to regenerate directory UUID for identifier: %@, class: %llu", identifier,
               static_cast<unsigned long long>(containerClass));
      }
    }
  }
}

uint64_t QRTClientConnection::diskUsageForUserId(uint32_t userId, const std::optional<QRTUUID>& uuid,
                                                 const std::optional<std::string>& identifier,
                                                 uint64_t containerClass, uint64_t* withError) {
  static constexpr const char* kStaticDiskUsage = "com.norvane.Emplacer.StaticDiskUsage";
  QRTErrorRef error;
  try {
    if (!validSelector(__func__, userId, uuid, containerClass, &error)) {
      reportCode(error, withError);
      return 0;
    }
    QRTIdentifierLock lock(uuid->UUIDString(), true);
    auto metadata = lookupByUUID(__func__, userId, *uuid, identifier, containerClass, &error);
    if (!metadata) {
      reportCode(error, withError);
      return 0;
    }
    const bool bundle = QRTIsBundleClass(containerClass);
    if (bundle) {
      uint64_t code = QRTErrorNone;
      auto stored = infoValueForKey(std::string(kStaticDiskUsage), userId, uuid, identifier, containerClass, false,
                                    &code);
      if (code != QRTErrorNone && code != QRTErrorInfoValueNotFound) {
        QRTLog(platform::kLogError, "Error looking up info value for userId: %u, identifier: %@, Class: %llu: %llu",
               userId, identifier, static_cast<unsigned long long>(containerClass),
               static_cast<unsigned long long>(code));
      }
      if (stored && stored->isInteger()) return stored->integer().asUnsigned();
    }
    uint64_t usage = QRTFileManager::defaultManager().diskUsageForURL(metadata->url());
    if (bundle) {
      uint64_t code = QRTErrorNone;
      const std::optional<plist::Value> value(std::in_place, usage);
      setInfoValue(value, std::string(kStaticDiskUsage), userId, uuid, identifier, containerClass, false, &code);
      if (code != QRTErrorNone) {
        QRTLog(platform::kLogError, "Error setting info value for userId: %u, identifier: %@, Class: %llu: %llu",
               userId, identifier, static_cast<unsigned long long>(containerClass),
               static_cast<unsigned long long>(code));
      }
    }
    return usage;
  } catch (...) {
    reportCode(QRT_EXCEPTION_ERROR(), withError);
    return 0;
  }
}

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

// Errors and log lines carry the operation's name, whichever helper makes them.
constexpr const char* kReplace = "replaceContainer";
constexpr const char* kRecover = "_recoverFromReplaceOperationsWithError";
#define QRT_ERROR_AS(function, code, underlying, ...) \
  QRTCreateError((function), __LINE__, QRTErrorDomain, (code), (underlying), nullptr, true, __VA_ARGS__)

bool isValidClass(uint64_t containerClass) { return containerClass >= 1 && containerClass <= 13; }

bool hasCode(const QRTErrorRef& error, const char* domain, int32_t code) {
  return error && error->domain() == domain && error->code() == code;
}

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
  QRTURL oldURL{};
  QRTURL newURL{};
  QRTURL destination{};
  QRTURL journal{};
  QRTURL staging{};
  bool destinationTransient = false;
  bool oldLeftCache = false;
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
  if (QRTContainerCache::sharedInstance().containerForUser(job.userIdNew, job.classNew, job.identifierNew, false,
                                                           &lookupError)) {
    return QRT_ERROR_AS(kReplace, QRTErrorAlreadyExists, nullptr,
                        "Container with identifier: %@, class: %ld, transient: %d already exists", job.identifierNew,
                        static_cast<long>(job.classNew), 0);
  }
  if (!hasCode(lookupError, QRTErrorDomain, QRTErrorNotFound)) return lookupError;
  return nullptr;
}

// The cache forgets the new container where it was and
// learns it at the destination under the old one's identity.
QRTErrorRef adoptNewContainer(ReplaceJob& job) {
  QRTContainerCache& cache = QRTContainerCache::sharedInstance();
  QRTMetadataRef metadata = job.newContainer;
  QRTErrorRef underlying;
  if (!cache.removeContainerForUser(job.userIdNew, job.classNew, job.identifierNew, metadata->transient(),
                                    &underlying)) {
    return QRT_ERROR_AS(kReplace, QRTErrorCacheRemoveFailed, underlying,
                        "Failed to remove from cache id: %@, class: %ld, transient: %d", job.identifierNew,
                        static_cast<long>(job.classNew), metadata->transient());
  }
  if (job.preserveOldUUID) metadata->setUuid(*job.oldUUID);
  metadata->setTransient(job.destinationTransient);
  if (!cache.addContainerMetadata(metadata, job.userIdNew, job.destination, job.destinationTransient, true,
                                  &underlying)) {
    return QRT_ERROR_AS(kReplace, QRTErrorCacheAddFailed, underlying,
                        "Failed to add to cache: %@, url: %@, transient: %d", metadata, job.destination,
                        job.destinationTransient);
  }
  // The internal UUID lives in the metadata file: without this the next
  // start would hand out the replacement's own UUID again.
  QRTErrorRef writeError;
  if (job.preserveOldUUID && !metadata->writeMetadataToDiskWithError(&writeError)) {
    QRTLogAs(kLogError, kReplace, "Failed to keep UUID %@ in metadata at %@ : %@", job.oldUUID, job.destination,
             writeError);
  }
  return nullptr;
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
    // Bundle classes drop the old identifier's code-signing information here, once the mapping service exists.
  }
  if (!files.moveItemAtURL(job.newURL, job.destination, &underlying)) {
    return QRT_ERROR_AS(kReplace, QRTErrorReplaceFailed, underlying, "Failed to replace: %@ with: %@ at: %@",
                        pathOrNil(job.oldURL), job.newURL, job.destination);
  }
  *restore = false;
  QRT_CRASH_POINT("replace-after-move-new");
  return adoptNewContainer(job);
}

// The old container was moved aside and the new one never arrived: its place
// and the destination are both empty. Only then does staging go back.
// Returns false when the move back failed, with error 35; *moved, when
// given, tells whether anything went back.
bool moveStagingBackIfAside(const QRTURL& old, const QRTURL& staging, const QRTURL& destination,
                            const char* function, const char* logFormat, bool* moved, QRTErrorRef* error) {
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

// After a failure or an exception. A failed move back ends the process before
// the clean-up could send the old content to death row: the journal stays
// and the start-up recovery finishes the restore. (A throw in here ends it
// too, through noexcept.)
void restoreOldContainer(ReplaceJob& job, bool afterException) noexcept {
  if (job.oldURL.empty() || job.destination.empty() || job.staging.empty()) return;
  bool moved = false;
  QRTErrorRef error;
  if (!moveStagingBackIfAside(job.oldURL, job.staging, job.destination, kReplace,
                              afterException ? "Recovering from exception by moving: %@ to %@" : nullptr, &moved,
                              &error)) {
    std::_Exit(EXIT_FAILURE);
  }
  // Re-added so that the restored container does not answer "not found"
  // until the next start rebuilds the cache from disk.
  QRTErrorRef cacheError;
  if (moved && job.oldLeftCache &&
      !QRTContainerCache::sharedInstance().addContainerMetadata(job.oldContainer, job.userIdOld, job.oldURL,
                                                                job.oldContainer->transient(), true, &cacheError)) {
    QRTLogAs(kLogError, kReplace, "Failed to add restored container to cache: %@ : %@", job.oldContainer,
             cacheError);
  }
}

// Hands staging and journal to death row. Its error, if any, replaces the
// operation's.
QRTErrorRef cleanUpReplace(QRTClientConnection& client, const ReplaceJob& job, bool startDeletionThread) {
  if (job.journal.empty()) return nullptr;
  QRT_CRASH_POINT("replace-before-cleanup");
  QRTErrorRef result;
  QRTErrorRef underlying;
  if (!client._moveItemAtURLToDeathRow(job.staging, true, false, &underlying)) {
    result = QRT_ERROR_AS(kReplace, QRTErrorRemoveItemFailed, underlying, "Failed to remove staging dir: %@",
                          job.staging);
  }
  if (!client._moveItemAtURLToDeathRow(job.journal, false, startDeletionThread, &underlying)) {
    result = QRT_ERROR_AS(kReplace, QRTErrorRemoveItemFailed, underlying, "Failed to remove replace file: %@",
                          job.journal);
  }
  QRT_CRASH_POINT("replace-after-cleanup");
  return result;
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
      job.staging = configuration.stagingDirectory().URLByAppendingPathComponent(name, true);
      if (!_writeToDiskReplaceAt(job.journal, job.oldURL, job.newURL, job.staging, job.destination, &error)) {
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
  } catch (...) {
    error = QRT_EXCEPTION_ERROR();
  }
  reportCode(error, withError);
}

bool QRTClientConnection::_writeToDiskReplaceAt(const QRTURL& replaceURL, const QRTURL& old, const QRTURL& withNew,
                                                const QRTURL& usingStaging, const QRTURL& toDestination,
                                                QRTErrorRef* error) {
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
  QRTErrorRef writeError;
  if (!QRT_writeToURL(journal, replaceURL, QRTWriteAtomic | QRTWriteFileProtectionNone, &writeError)) {
    QRTSetError(error, QRT_ERROR(QRTErrorWriteFailed, writeError, true, "Failed to write replace dictionary to URL %@",
                                 replaceURL));
    return false;
  }
  return true;
}

std::optional<std::map<std::string, QRTURL>> QRTClientConnection::_readAndValidateReplaceFileAtUrl(
    const QRTURL& url, QRTErrorRef* error) {
  QRTErrorRef readError;
  std::optional<plist::Dictionary> journal = QRT_dictionaryWithContentsOfURL(url, &readError);
  if (!journal) {
    QRTSetError(error, QRT_ERROR(QRTErrorReplaceJournalFailed, readError, true, "Failed to read replace file at URL %@",
                                 url));
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
      auto info = _readAndValidateReplaceFileAtUrl(journalURL, nullptr);
      if (info) {
        QRTLog(kLogDebug, "Doing a replace of %@ with info: %@", journalURL, plist::Value(journalDescription(*info)));
        if (!moveStagingBackIfAside(info->at(kOldURLKey), info->at(kStagingURLKey), info->at(kDestURLKey), kRecover,
                                    "Recovering from failed replace by moving: %@ to %@", nullptr, error)) {
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
