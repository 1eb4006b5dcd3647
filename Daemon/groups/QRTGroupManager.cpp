#include "Daemon/groups/QRTGroupManager.h"

#include <algorithm>

#include "Daemon/QRTError.h"
#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTLocks.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTPerUserConfiguration.h"
#include "platform/DeviceProperties.h"
#include "platform/Log.h"

using platform::kLogDebug;
using platform::kLogError;
using platform::kLogNotice;

namespace {

bool mobileUserHasBase(uint32_t user) {
  return QRTGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(user)->existsUserBaseDirectory();
}

// Sends one group container to death row; the caller holds the all-identifiers lock.
void stageGroupContainer(const QRTMetadataRef& container, uint32_t user) {
  uint64_t code = QRTErrorNone;
  QRTClientConnection::sharedClientConnection().stageForDeleteContainersWithUsers(
      {user}, {container->uuid()}, {container->identifier()}, {container->containerClass()}, false, &code);
  if (code != QRTErrorNone) {
    QRTLog(kLogError, "Failed to destroy group container with identifier %@ for %u: %llu", container->identifier(),
           user, static_cast<unsigned long long>(code));
  }
}

// Error 11, in the caller's name, when there is no identifier.
bool identifierGiven(const char* function, uint32_t userId, const std::optional<std::string>& identifier,
                     uint64_t* withError) {
  if (identifier) return true;
  QRTErrorRef error = QRTCreateError(function, __LINE__, QRTErrorDomain, QRTErrorInvalidParameter, nullptr, nullptr,
                                     true, "Can't act on an invalid object: userId: %u, ID: %@", userId, identifier);
  if (withError) *withError = error->resultCode();
  return false;
}

}  // namespace

QRTGroupManager& QRTGroupManager::defaultManager() {
  static QRTGroupManager* const manager = new QRTGroupManager();
  return *manager;
}

std::optional<QRTGroupManager::ReferenceCounts> QRTGroupManager::_copyReferenceCountSetOfType(QRTGroupType type) {
  QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance();
  if (!mapping) return std::nullopt;
  return mapping->_onQueue_groupReferenceCounts(type);
}

void QRTGroupManager::handleChangeFromOldGroupContainerIds(
    const std::optional<std::vector<std::string>>& oldIds,
    const std::optional<std::vector<std::string>>& toNewGroupContainerIds, QRTGroupType ofType) {
  if (oldIds == toNewGroupContainerIds || !oldIds) return;
  std::vector<std::string> removed;
  for (const std::string& id : *oldIds) {
    if (!toNewGroupContainerIds || std::find(toNewGroupContainerIds->begin(), toNewGroupContainerIds->end(), id) ==
                                       toNewGroupContainerIds->end()) {
      removed.push_back(id);
    }
  }
  if (!removed.empty()) _removeReferenceForGroupIdentifiers(removed, ofType);
}

void QRTGroupManager::_removeReferenceForGroupIdentifiers(const std::vector<std::string>& removed, QRTGroupType type) {
  std::optional<ReferenceCounts> counts = _copyReferenceCountSetOfType(type);
  if (!counts) {
    QRTLog(kLogError, "Failed to get reference count information for group type: %ld", static_cast<long>(type));
    return;
  }
  if (type == QRTGroupTypeSystem) {
    _removeGroupContainersIfNeededforUser(QRTSystemContainerUserId, QRTClassSystemGroup, removed, *counts);
    return;
  }
  const uint32_t mobile = QRTGlobalConfiguration::sharedInstance().currentMobileUserId();
  if (mobileUserHasBase(mobile)) _removeGroupContainersIfNeededforUser(mobile, QRTClassAppGroup, removed, *counts);
}

void QRTGroupManager::_removeGroupContainersIfNeededforUser(uint32_t user, uint64_t groupContainerClass,
                                                            const std::vector<std::string>& identifiers,
                                                            ReferenceCounts referenceCounts) {
  QRTContainerCache& cache = QRTContainerCache::sharedInstance();
  for (const std::string& identifier : identifiers) {
    int64_t& count = referenceCounts[identifier];
    if (count == 1) {
      QRTErrorRef error;
      QRTMetadataRef container = cache.containerForUser(user, groupContainerClass, identifier, false, &error);
      if (!container) {
        QRTLog(kLogDebug, "Failed to retrieve group container %@ for %u : %@.  May not exist for this user", identifier,
               user, error);
      } else {
        QRTLog(kLogNotice, "Last reference to group container %@ for %u is going away; removing it.", identifier, user);
        stageGroupContainer(container, user);
      }
    } else {
      QRTLog(kLogDebug, "Reference count for user: %u, ID: %@ is %ld", user, identifier, static_cast<long>(count));
    }
    --count;
  }
}

void QRTGroupManager::reconcileGroupContainersOfType(QRTGroupType type) {
  std::optional<ReferenceCounts> counts = _copyReferenceCountSetOfType(type);
  if (!counts) {
    QRTLog(kLogError, "Failed to get reference count information for group type: %ld", static_cast<long>(type));
    return;
  }
  if (type == QRTGroupTypeSystem) {
    _cleanupUnreferencedGroupContainersForUser(QRTSystemContainerUserId, QRTClassSystemGroup, *counts);
    return;
  }
  const uint32_t mobile = QRTGlobalConfiguration::sharedInstance().currentMobileUserId();
  if (mobileUserHasBase(mobile)) _cleanupUnreferencedGroupContainersForUser(mobile, QRTClassAppGroup, *counts);
}

void QRTGroupManager::_cleanupUnreferencedGroupContainersForUser(uint32_t user, uint64_t containerClass,
                                                                 const ReferenceCounts& referenceCounts) {
  QRTErrorRef error;
  auto containers = QRTContainerCache::sharedInstance().allContainersForUser(user, containerClass, false, &error);
  if (!containers) {
    QRTLog(kLogError, "Failed to fetch group container list for %u: %@", user, error);
    return;
  }
  for (const QRTMetadataRef& container : *containers) {
    auto it = referenceCounts.find(container->identifier());
    if (it != referenceCounts.end() && it->second > 0) continue;
    QRTLog(kLogError, "Removing group container with identifier %@ for %u", container->identifier(), user);
    stageGroupContainer(container, user);
  }
}

std::optional<std::map<std::string, std::string>> QRTGroupManager::groupContainerPathsForUser(
    uint32_t userId, QRTClientConnection& clientConnection, const std::optional<std::string>& identifier,
    uint64_t* withError) {
  if (!identifierGiven(__func__, userId, identifier, withError)) return std::nullopt;
  std::optional<std::map<std::string, std::string>> paths;
  auto body = [&] {
    QRTAllIdentifiersLock lock(true);
    const bool system = userId == QRTSystemContainerUserId;
    const uint64_t groupClass = system ? QRTClassSystemGroup : QRTClassAppGroup;
    QRTGroupList groups;
    if (QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance()) {
      groups = system ? mapping->systemGroupIdentifiersForIdentifier(*identifier)
                      : mapping->appGroupIdentifiersForIdentifier(*identifier);
    }
    if (identifier != clientConnection.clientBundleIdentifier() && !clientConnection.allowOtherIdLookup() &&
        platform::deviceIsInternalBuild()) {
      QRTLog(kLogDebug,
             "%@ trying to retrieve group containers of class %ld for identifier: %@. WARNING: Soon you will need an "
             "entitlement to do this. File a Bugline in \"QuarterKit | all\"",
             clientConnection.clientBundleIdentifier(), static_cast<long>(groupClass), identifier);
    }
    clientConnection.setAllowGroupIdLookup(true);
    std::map<std::string, std::string> found;
    for (const std::string& group : groups ? *groups : std::vector<std::string>{}) {
      uint64_t code = QRTErrorNone;
      QRTMetadataRef container = clientConnection.createOrLookupContainerForUser(
          {userId, groupClass, group}, QRTCreateMode::CreateIfMissing, QRTLocking::CallerHoldsLocks, &code);
      if (!container) {
        QRTLog(kLogError, "Failed to create or lookup group container-userId: %u, ID: %@ : %llu", userId, group,
               static_cast<unsigned long long>(code));
        continue;
      }
      found[group] = container->url().path();
    }
    paths = std::move(found);
  };
  QRTErrorRef failure = QRT_GUARD(body);
  if (failure) {
    if (withError) *withError = failure->resultCode();
    return std::nullopt;
  }
  return paths;
}

std::optional<std::vector<std::string>> QRTGroupManager::groupContainerIdentifiersForUser(
    uint32_t userId, const std::optional<std::string>& identifier, uint64_t* withError) {
  if (!identifierGiven(__func__, userId, identifier, withError)) return std::nullopt;
  std::optional<std::vector<std::string>> identifiers;
  QRTErrorRef failure = QRT_GUARD([&] {
    QRTAllIdentifiersLock lock(true);
    QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance();
    QRTGroupList groups = mapping ? mapping->appGroupIdentifiersForIdentifier(*identifier) : std::nullopt;
    identifiers = groups ? std::move(*groups) : std::vector<std::string>{};
  });
  if (failure) {
    if (withError) *withError = failure->resultCode();
    return std::nullopt;
  }
  return identifiers;
}
