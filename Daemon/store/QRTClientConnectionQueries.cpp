#include "Daemon/store/QRTClientConnection.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <map>
#include <iterator>

#include "base/QRTUUID.h"
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

// ---- Queries and info values ----

namespace {

bool validSelector(const char* function, uint32_t userId, const std::optional<QRTUUID>& uuid, uint64_t containerClass,
                   QRTErrorRef* error) {
  if (uuid && containerClass >= QRTClassAppBundle && containerClass <= QRTClassSystemGroup) return true;
  QRTSetError(error, QRTCreateError(function, __LINE__, QRTErrorDomain, QRTErrorInvalidParameter, nullptr, nullptr,
                                    true, "Can't act on an invalid object: userId: %u, UUID: %@, Class: %ld", userId,
                                    uuid, static_cast<long>(containerClass)));
  return false;
}

QRTMetadataRef lookupByUUID(const char* function, uint32_t userId, const QRTUUID& uuid,
                            const std::optional<std::string>& identifier, uint64_t containerClass, QRTErrorRef* error) {
  auto metadata =
      QRTContainerCache::sharedInstance().containerForUser(userId, containerClass, identifier, uuid.UUIDString());
  if (!metadata) {
    QRTSetError(error, QRTCreateError(function, __LINE__, QRTErrorDomain, QRTErrorNotFound, nullptr, nullptr, true,
                                      "No Container with userId: %u UUID: %@, identifier: %@, Class: %ld", userId, uuid,
                                      identifier, static_cast<long>(containerClass)));
  }
  return metadata;
}

}  // namespace

std::optional<std::vector<QRTMetadataRef>> QRTClientConnection::containersForUser(uint32_t userId, uint64_t withClass,
                                                                                  bool transient, uint64_t* withError) {
  if (withClass < QRTClassAppBundle || withClass > QRTClassSystemGroup) {
    reportCode(
        QRT_ERROR(QRTErrorInvalidParameter, nullptr, true, "Can't act on an invalid container-userId: %u, class: %ld",
                  userId, static_cast<long>(withClass)),
        withError);
    return std::nullopt;
  }
  QRTErrorRef error;
  try {
    QRTAllIdentifiersLock lock(false);
    auto list = QRTContainerCache::sharedInstance().allContainersForUser(userId, withClass, transient, &error);
    if (list) return list;
  } catch (...) { error = QRT_EXCEPTION_ERROR(); }
  reportCode(error, withError);
  return std::nullopt;
}

QRTMetadataRef QRTClientConnection::metadataForUser(uint32_t userId, const std::optional<QRTUUID>& withUUID,
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
  } catch (...) { error = QRT_EXCEPTION_ERROR(); }
  reportCode(error, withError);
  return nullptr;
}

void QRTClientConnection::setInfoValue(const std::optional<plist::Value>& value,
                                       const std::optional<std::string>& forKey, uint32_t userId,
                                       const std::optional<QRTUUID>& uuid, const std::optional<std::string>& identifier,
                                       uint64_t containerClass, bool useLocking, uint64_t* withError) {
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
    // The file first: a refused or failed write leaves the cached metadata as it was.
    QRTMetadataRef changed = metadata->withInfo(std::move(info));
    if (!changed->writeMetadataToDiskWithError(&error)) return reportCode(error, withError);
    QRTErrorRef cacheError;
    if (!QRTContainerCache::sharedInstance().addContainerMetadata(changed, changed->uid(), changed->url(),
                                                                  changed->transient(), false, &cacheError)) {
      reportCode(
          QRT_ERROR(QRTErrorCacheAddFailed, cacheError, true, "Failed to add to cache: %@, url: %@, transient: %d",
                    changed, changed->url(), changed->transient()),
          withError);
    }
  } catch (...) { reportCode(QRT_EXCEPTION_ERROR(), withError); }
}

std::optional<plist::Value> QRTClientConnection::infoValueForKey(const std::optional<std::string>& key, uint32_t userId,
                                                                 const std::optional<QRTUUID>& uuid,
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
  } catch (...) { error = QRT_EXCEPTION_ERROR(); }
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
  } catch (...) { reportCode(QRT_EXCEPTION_ERROR(), withError); }
}

std::vector<QRTMetadataRef> QRTClientConnection::_containersToRename(uint32_t userId, const QRTUUID& uuid,
                                                                     const std::optional<std::string>& identifier,
                                                                     uint64_t containerClass, QRTErrorRef* error) {
  std::vector<QRTMetadataRef> chosen;
  const bool multiUser = QRTIsPerUserClass(containerClass) && (platform::deviceMultiUserFlags() & 0x80000000u);
  if (!multiUser) {
    if (auto metadata =
            lookupByUUID("regenerateDirectoryUUIDForUser", userId, uuid, identifier, containerClass, error)) {
      chosen.push_back(std::move(metadata));
    }
    return chosen;
  }
  // Every user of the device: on this platform, the current mobile user.
  for (uint32_t user : {QRTGlobalConfiguration::sharedInstance().currentMobileUserId()}) {
    auto metadata = QRTContainerCache::sharedInstance().containerForUser({user, containerClass, identifier}, nullptr);
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
        return reportCode(
            QRT_ERROR(QRTErrorInvalidParameter, nullptr, true,
                      "Non-UUID last path component: %@ for identifier: %@, userId: %u, Class: %ld",
                      oldURL.lastPathComponent(), identifier, metadata->uid(), static_cast<long>(containerClass)),
            withError);
      }
      QRTURL newURL =
          oldURL.URLByDeletingLastPathComponent().URLByAppendingPathComponent(QRTUUID::random().UUIDString(), true);
      QRTErrorRef moveError;
      if (!QRTFileManager::defaultManager().moveItemAtURL(oldURL, newURL, &moveError)) {
        return reportCode(QRT_ERROR(QRTErrorMoveToNewUUIDFailed, moveError, true,
                                    "Failed to move dir: %@ to new UUID dir: %@", oldURL, newURL),
                          withError);
      }
      QRTErrorRef cacheError;
      if (!QRTContainerCache::sharedInstance().addContainerMetadata(metadata, metadata->uid(), newURL,
                                                                    metadata->transient(), true, &cacheError)) {
        return reportCode(
            QRT_ERROR(QRTErrorCacheAddFailed, cacheError, true, "Failed to add to cache: %@, url: %@, transient: %d",
                      metadata, newURL, metadata->transient()),
            withError);
      }
    }
  } catch (...) { reportCode(QRT_EXCEPTION_ERROR(), withError); }
}

uint64_t QRTClientConnection::diskUsageForUserId(uint32_t userId, const std::optional<QRTUUID>& uuid,
                                                 const std::optional<std::string>& identifier, uint64_t containerClass,
                                                 uint64_t* withError) {
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
      auto stored =
          infoValueForKey(std::string(kStaticDiskUsage), userId, uuid, identifier, containerClass, false, &code);
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
