// Group containers (class 7, per user) and system group containers (class
// 13, user 499) live while a stored program's entitlements name their group.
// The group manager keeps no count: the code-signing mapping counts the
// names and hands the counts over with each change.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

class QRTClientConnection;
class QRTGroupNames;

enum QRTGroupType : int64_t { QRTGroupTypeApplication = 0, QRTGroupTypeSystem = 1 };

class QRTGroupManager {
 public:
  static QRTGroupManager& defaultManager();

  using ReferenceCounts = std::map<std::string, int64_t>;

  // The groups of oldIds that newIds no longer names.
  static std::vector<std::string> droppedGroups(const std::optional<std::vector<std::string>>& oldIds,
                                                const std::optional<std::vector<std::string>>& newIds);
  // Called on the code-signing queue, under the all-identifiers lock, before
  // the program's new entry is stored, with the counts as they stand then
  // (nothing when they could not be had): a group the program drops goes to
  // death row when the program was the last to name it.
  void removeReferencesForGroupIdentifiers(const std::vector<std::string>& removed, QRTGroupType type,
                                           const std::optional<ReferenceCounts>& counts);
  // Sends every group container that the counts do not name to death row.
  void reconcileGroupContainersOfType(QRTGroupType type, const std::optional<ReferenceCounts>& counts);

  // Group identifier to container path, the containers made on demand
  // (QRTEntitledGroupContainers.cpp). The program's groups come from names
  // (the code-signing mapping); none when it is null.
  std::optional<std::map<std::string, std::string>> groupContainerPathsForUser(
      uint32_t userId, QRTClientConnection& clientConnection, const std::optional<std::string>& identifier,
      QRTGroupNames* names, uint64_t* withError);
  std::optional<std::vector<std::string>> groupContainerIdentifiersForUser(uint32_t userId,
                                                                           const std::optional<std::string>& identifier,
                                                                           QRTGroupNames* names, uint64_t* withError);

 private:
  QRTGroupManager() = default;
  // Works on its own copy of the counts.
  void _removeGroupContainersIfNeededforUser(uint32_t user, uint64_t groupContainerClass,
                                             const std::vector<std::string>& identifiers,
                                             ReferenceCounts referenceCounts);
  void _cleanupUnreferencedGroupContainersForUser(uint32_t user, uint64_t containerClass,
                                                  const ReferenceCounts& referenceCounts);
};
