#include "Daemon/QRTClientConnection.h"

#include <algorithm>
#include <cerrno>
#include <iterator>

#include "base/QRTUUID.h"
#include "Daemon/QRTContainerCache.h"
#include "Daemon/QRTContentClass.h"
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

void QRTClientConnection::quarterSetup() {
  // Before quarterCleanup empties staging: a rollback moves a container back out of it.
  QRTErrorRef error;
  if (!_recoverFromReplaceOperationsWithError(&error)) {
    QRTLog(platform::kLogError, "Failed recovering from replace operations: %@", error);
  }
}

void QRTClientConnection::quarterCleanup() {
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
      setInfoValue(plist::Value(usage), std::string(kStaticDiskUsage), userId, uuid, identifier, containerClass, false,
                   &code);
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
