// Group containers (class 7, per user) and system group containers (class
// 13, user 499) live while a stored program's entitlements name their group.
// No count is stored: each change counts the names again from the mapping.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

class QRTClientConnection;

enum QRTGroupType : int64_t { QRTGroupTypeApplication = 0, QRTGroupTypeSystem = 1 };

class QRTGroupManager {
 public:
  static QRTGroupManager& defaultManager();

  // Called on the code-signing queue, under the all-identifiers lock, before
  // the program's new entry is stored: a group the program drops goes to
  // death row when the program was the last to name it.
  void handleChangeFromOldGroupContainerIds(const std::optional<std::vector<std::string>>& oldIds,
                                            const std::optional<std::vector<std::string>>& toNewGroupContainerIds,
                                            QRTGroupType ofType);
  // Sends every group container that no stored program names to death row.
  void reconcileGroupContainersOfType(QRTGroupType type);

  // Group identifier to container path, the containers made on demand.
  std::optional<std::map<std::string, std::string>> groupContainerPathsForUser(
      uint32_t userId, QRTClientConnection& clientConnection, const std::optional<std::string>& identifier,
      uint64_t* withError);
  std::optional<std::vector<std::string>> groupContainerIdentifiersForUser(uint32_t userId,
                                                                           const std::optional<std::string>& identifier,
                                                                           uint64_t* withError);

 private:
  using ReferenceCounts = std::map<std::string, int64_t>;

  QRTGroupManager() = default;
  std::optional<ReferenceCounts> _copyReferenceCountSetOfType(QRTGroupType type);
  void _removeReferenceForGroupIdentifiers(const std::vector<std::string>& removed, QRTGroupType ofType);
  // Works on its own copy of the counts.
  void _removeGroupContainersIfNeededforUser(uint32_t user, uint64_t groupContainerClass,
                                             const std::vector<std::string>& identifiers,
                                             ReferenceCounts referenceCounts);
  void _cleanupUnreferencedGroupContainersForUser(uint32_t user, uint64_t containerClass,
                                                  const ReferenceCounts& referenceCounts);
};
