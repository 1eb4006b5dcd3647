// The group containers that a program's entitlements name, made on demand:
// the group manager's look-ups, which learn the names from the mapping
// through QRTGroupNames.

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/QRTError.h"
#include "Daemon/groups/QRTGroupManager.h"
#include "Daemon/groups/QRTGroupNames.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTLocks.h"
#include "Daemon/store/QRTMetadata.h"
#include "platform/DeviceProperties.h"
#include "platform/Log.h"

using platform::kLogDebug;
using platform::kLogError;

namespace {

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

std::optional<std::map<std::string, std::string>> QRTGroupManager::groupContainerPathsForUser(
    uint32_t userId, QRTClientConnection& clientConnection, const std::optional<std::string>& identifier,
    QRTGroupNames* names, uint64_t* withError) {
  if (!identifierGiven(__func__, userId, identifier, withError)) return std::nullopt;
  std::optional<std::map<std::string, std::string>> paths;
  auto body = [&] {
    QRTAllIdentifiersLock lock(true);
    const bool system = userId == QRTSystemContainerUserId;
    const uint64_t groupClass = system ? QRTClassSystemGroup : QRTClassAppGroup;
    QRTGroupList groups;
    if (names) {
      groups = system ? names->systemGroupIdentifiersForIdentifier(*identifier)
                      : names->appGroupIdentifiersForIdentifier(*identifier);
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
    uint32_t userId, const std::optional<std::string>& identifier, QRTGroupNames* names, uint64_t* withError) {
  if (!identifierGiven(__func__, userId, identifier, withError)) return std::nullopt;
  std::optional<std::vector<std::string>> identifiers;
  QRTErrorRef failure = QRT_GUARD([&] {
    QRTAllIdentifiersLock lock(true);
    QRTGroupList groups = names ? names->appGroupIdentifiersForIdentifier(*identifier) : std::nullopt;
    identifiers = groups ? std::move(*groups) : std::vector<std::string>{};
  });
  if (failure) {
    if (withError) *withError = failure->resultCode();
    return std::nullopt;
  }
  return identifiers;
}
