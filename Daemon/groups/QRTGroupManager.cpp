#include "Daemon/groups/QRTGroupManager.h"

#include <algorithm>

#include "Daemon/QRTError.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
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

}  // namespace

QRTGroupManager& QRTGroupManager::defaultManager() {
  static QRTGroupManager* const manager = new QRTGroupManager();
  return *manager;
}

std::vector<std::string> QRTGroupManager::droppedGroups(const std::optional<std::vector<std::string>>& oldIds,
                                                        const std::optional<std::vector<std::string>>& newIds) {
  std::vector<std::string> removed;
  if (oldIds == newIds || !oldIds) return removed;
  for (const std::string& id : *oldIds) {
    if (!newIds || std::find(newIds->begin(), newIds->end(), id) == newIds->end()) removed.push_back(id);
  }
  return removed;
}

void QRTGroupManager::removeReferencesForGroupIdentifiers(const std::vector<std::string>& removed, QRTGroupType type,
                                                          const std::optional<ReferenceCounts>& counts) {
  if (removed.empty()) return;
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
      QRTMetadataRef container = cache.containerForUser({user, groupContainerClass, identifier}, &error);
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

void QRTGroupManager::reconcileGroupContainersOfType(QRTGroupType type, const std::optional<ReferenceCounts>& counts) {
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
