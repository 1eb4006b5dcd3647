#include "Daemon/requests/QRTRequestDispatcher.h"

#include <iterator>
#include <mutex>
#include <unordered_map>

#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/requests/QRTCodeSigningCommands.h"
#include "Daemon/requests/QRTContainerCommands.h"
#include "Daemon/requests/QRTDataProtectionCommands.h"
#include "Daemon/requests/QRTOperationsCommands.h"
#include "Daemon/requests/QRTSpecialCommands.h"
#include "Daemon/requests/QRTVerifyCommand.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/QRTError.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "platform/Identity.h"
#include "platform/Log.h"
#include "platform/UserDatabase.h"

using platform::kLogError;

namespace {
bool requestIdentifiersValid(const plist::Dictionary& request, uint32_t callerUid, uint64_t command);
}  // namespace

#define SERVED(n, name, handler, entitlement, flag) \
  { n, name, handler, entitlement, flag }
const QRTCommandRow QRTCommandTable[QRTCommandCount] = {
    SERVED(QRTCommandCreateOrLookupContainer, "createOrLookupContainer", QRTHandleCreateOrLookupContainer,
           QRTEntitlementNone, 1),
    SERVED(QRTCommandContainersForUser, "containersForUser", QRTHandleContainersForUser, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandReplaceContainer, "replaceContainer", QRTHandleReplaceContainer, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandStageContainerForDelete, "stageContainerForDelete", QRTHandleStageContainerForDelete,
           QRTEntitlementAllowed, 1),
    SERVED(QRTCommandDeleteContainersOnDeathRow, "deleteContainersOnDeathRow", QRTHandleDeleteContainersOnDeathRow,
           QRTEntitlementAllowed, 0),
    SERVED(QRTCommandSetInfoValue, "setInfoValue", QRTHandleSetInfoValue, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandInfoValueForKey, "infoValueForKey", QRTHandleInfoValueForKey, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandMetadataForContainer, "metadataForContainer", QRTHandleMetadataForContainer, QRTEntitlementAllowed,
           1),
    SERVED(QRTCommandRecreateDefaultStructure, "recreateDefaultStructure", QRTHandleRecreateDefaultStructure,
           QRTEntitlementAllowed, 1),
    SERVED(QRTCommandRegenerateDirectoryUUID, "regenerateDirectoryUUID", QRTHandleRegenerateDirectoryUUID,
           QRTEntitlementAllowed, 1),
    SERVED(QRTCommandDeleteContainer, "deleteContainer", QRTHandleDeleteContainer, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandWipeAddonDataContainer, "wipeAddonDataContainer", QRTHandleWipeAddonDataContainer,
           QRTEntitlementWipeContainer, 1),
    SERVED(QRTCommandDeleteDataContainerContent, "deleteDataContainerContent", QRTHandleDeleteDataContainerContent,
           QRTEntitlementAllowed, 1),
    SERVED(QRTCommandGroupContainerPaths, "groupContainerPaths", QRTHandleGroupContainerPaths, QRTEntitlementNone, 1),
    SERVED(QRTCommandGroupContainerIdentifiers, "groupContainerIdentifiers", QRTHandleGroupContainerIdentifiers,
           QRTEntitlementAllowed, 1),
    SERVED(QRTCommandSystemContainerPath, "systemContainerPath", QRTHandleSystemContainerPath, QRTEntitlementNone, 1),
    SERVED(QRTCommandSystemGroupContainerPaths, "systemGroupContainerPaths", QRTHandleSystemGroupContainerPaths,
           QRTEntitlementNone, 1),
    SERVED(QRTCommandSystemGroupContainerPath, "systemGroupContainerPath", QRTHandleSystemGroupContainerPath,
           QRTEntitlementNone, 1),
    SERVED(QRTCommandProcessCodeSigningInfo, "processCodeSigningInfo", QRTHandleProcessCodeSigningInfo,
           QRTEntitlementAllowed, 1),
    SERVED(QRTCommandCodeSigningInfoForIdentifier, "codeSigningInfoForIdentifier",
           QRTHandleCodeSigningInfoForIdentifier, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandInvalidateCodeSigningInfoForAppsWithoutBundleContainer,
           "invalidateCodeSigningInfoForAppsWithoutBundleContainer",
           QRTHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandSetDataProtection, "setDataProtection", QRTHandleSetDataProtection, QRTEntitlementAllowed, 0),
    SERVED(QRTCommandRecreateContainerStructure, "recreateContainerStructure", QRTHandleRecreateDefaultStructure,
           QRTEntitlementAllowed, 1),
    SERVED(QRTCommandDiskUsage, "diskUsage", QRTHandleDiskUsage, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandPerformDataMigration, "performDataMigration", QRTHandlePerformDataMigration,
           QRTEntitlementDataMigration, 1),
    SERVED(QRTCommandRetryTest, "retryTest", QRTHandleRetryTest, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandStageSharedContent, "stageSharedContent", QRTHandleStageSharedContent,
           QRTEntitlementStageSharedContent, 1),
    SERVED(QRTCommandSetNetworkExtension, "setNetworkExtension", QRTHandleSetNetworkExtension,
           QRTEntitlementNetworkExtension, 1),
    SERVED(QRTCommandUserManagedAssetsPath, "userManagedAssetsPath", QRTHandleUserManagedAssetsPath,
           QRTEntitlementUserManagedAssets, 1),
    SERVED(QRTCommandDeleteUserManagedAsset, "deleteUserManagedAsset", QRTHandleDeleteUserManagedAsset,
           QRTEntitlementUserManagedAssets, 1),
};
const QRTCommandRow QRTExtensionCommandTable[] = {
    SERVED(QRTCommandVerify, "verify", QRTHandleVerify, QRTEntitlementAllowed, 0),
    SERVED(QRTCommandStatus, "status", QRTHandleStatus, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandMetrics, "metrics", QRTHandleMetrics, QRTEntitlementAllowed, 1),
    SERVED(QRTCommandSetLogLevel, "setLogLevel", QRTHandleSetLogLevel, QRTEntitlementAllowed, 1),
};
#undef SERVED

const QRTCommandRow* QRTCommandRowFor(uint64_t command) {
  if (command < QRTCommandCount) return &QRTCommandTable[command];
  for (const QRTCommandRow& row : QRTExtensionCommandTable)
    if (row.command == command) return &row;
  return nullptr;
}

void QRTProcessRelayEvent(const platform::ConnectionRef& connection, platform::RequestEvent& event) {
  if (!event.message) {
    QRTLog(kLogError, "Dictionary does not have reply context");
    QRTLog(platform::kLogDebug, "Unreadable frame: %s", event.failure.c_str());
    connection->cancel();
    return;
  }
  const plist::Dictionary& request = *event.message;
  const auto& peer = connection->peer();
  platform::RefusalScope refusals(peer ? peer->uid : UINT32_MAX);
  uint64_t command = QRTMessageU64(request, QRTKeyCommand);
  auto reply = std::make_shared<QRTReply>(connection, event.messageId);
  uint64_t result = QRTErrorNone;
  bool handled = false;
  const QRTCommandRow* found = QRTCommandRowFor(command);
  reply->countAs(command, found ? found->name : "invalidCommand", peer ? peer->uid : UINT32_MAX,
                 peer ? static_cast<int>(peer->pid) : 0);
  if (!found) {
    QRTLog(kLogError, "Invalid command index: %lld", static_cast<long long>(command));
    result = QRTErrorInvalidRequest;
  } else {
    const QRTCommandRow& row = *found;
    std::optional<QRTClientConnection> client = checkEntitlementsAndInitClientObject(*connection, row.entitlement);
    if (client && platform::logEnabled(platform::kLogDebug))
      reply->setCallerIdentifier(client->clientBundleIdentifier());
    if (!client) {
      result = QRTErrorNotEntitled;
    } else if (!requestIdentifiersValid(request, client->clientUserId(), command)) {
      result = QRTErrorInvalidParameter;
    } else {
      handled = true;
      QRTErrorRef failure = QRT_GUARD([&] { row.handler(request, reply, *client, &result); });
      if (failure) result = failure->resultCode();
    }
  }
  if (!handled || found->replyOnReturn == 1 || result != QRTErrorNone) reply->send(result);
}

namespace {

bool entitlementTrue(const plist::Dictionary& entitlements, const char* name) {
  const plist::Value* v = plist::find(entitlements, name);
  const bool* b = v ? v->booleanIf() : nullptr;
  return b && *b;
}

// Registration runs on every request of an entitled caller; its answer stays
// the same while neither the caller's identity nor the database changes.
struct RegistrationMemo {
  std::shared_ptr<const platform::CodeIdentity> identity;
  uint64_t generation = 0;
};
std::mutex gRegistrationMemoLock;
std::unordered_map<std::string, RegistrationMemo>& registrationMemo() {
  static auto* memo = new std::unordered_map<std::string, RegistrationMemo>();
  return *memo;
}
// Signing identifiers come from the identity registry, but the memo is
// dropped whole rather than grow without bound.
constexpr size_t kRegistrationMemoLimit = 4096;

void registerCallerEntitlements(const std::shared_ptr<const platform::CodeIdentity>& caller) {
  QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance();
  if (!mapping || !caller->signingIdentifier || !caller->entitlements) return;
  const std::string& identifier = *caller->signingIdentifier;
  {
    std::lock_guard<std::mutex> hold(gRegistrationMemoLock);
    auto it = registrationMemo().find(identifier);
    if (it != registrationMemo().end() && it->second.identity == caller &&
        it->second.generation == mapping->generation()) {
      return;
    }
  }
  // Read before the look-ups: a write that lands while they run makes the
  // next request look again.
  const uint64_t generation = mapping->generation();
  if (mapping->identifierHasCallerRegisteredEntitlements(identifier) ||
      !mapping->codeSigningInfoExistForIdentifier(identifier)) {
    uint64_t code = mapping->processCallerRegisteredEntitlements(*caller->entitlements, identifier);
    if (code != QRTErrorNone) {
      QRTLogAs(kLogError, "checkEntitlementsAndInitClientObject", "Error processing entitlements for %@ : %llu",
               identifier, static_cast<unsigned long long>(code));
      return;
    }
  }
  std::lock_guard<std::mutex> hold(gRegistrationMemoLock);
  if (registrationMemo().size() >= kRegistrationMemoLimit) registrationMemo().clear();
  registrationMemo()[identifier] = RegistrationMemo{caller, generation};
}

std::optional<std::vector<std::string>> stringArray(const plist::Value& value) {
  const plist::Array* array = value.arrayIf();
  if (!array) return std::nullopt;
  std::vector<std::string> strings;
  for (const plist::Value& item : *array) {
    if (const std::string* s = item.stringIf()) strings.push_back(*s);
  }
  return strings;
}

}  // namespace

std::optional<QRTClientConnection> checkEntitlementsAndInitClientObject(const platform::RequestConnection& connection,
                                                                        const char* entitlement) {
  const auto& peer = connection.peer();
  int pid = peer ? static_cast<int>(peer->pid) : 0;
  std::shared_ptr<const platform::CodeIdentity> caller =
      peer ? platform::identityForPeer(*peer) : platform::identityForExecutable("");
  const platform::CodeIdentity& identity = *caller;
  if (!peer || peer->executable.empty()) {
    QRTLog(kLogError, "Failed to copy signing ID for pid %d : %@", pid,
           std::string(peer ? "process executable unreadable" : "peer credentials unreadable"));
  }
  const std::string requirement = entitlement;
  const bool requiresNone = requirement == QRTEntitlementNone;
  const uint32_t userId = peer ? peer->uid : UINT32_MAX;
  QRTClientConnection::Rights rights{pid, userId == 0 || identity.systemLevel, identity.systemLevel, false};
  auto refuse = [&]() -> std::optional<QRTClientConnection> {
    QRTLogEntitlementRefusal(userId, pid, identity.signingIdentifier, entitlement);
    return std::nullopt;
  };
  if (!identity.entitlements || identity.entitlements->empty()) {
    if (!requiresNone) return refuse();
    QRTClientConnection client(identity.signingIdentifier, userId, false, std::nullopt);
    client.setRights(rights);
    return client;
  }
  const plist::Dictionary& entitlements = *identity.entitlements;
  const bool allowed = entitlementTrue(entitlements, QRTEntitlementAllowed);
  const bool otherIdLookup = allowed || entitlementTrue(entitlements, QRTEntitlementOtherIdLookup);
  std::optional<std::vector<std::string>> wipeIdentifiers;
  if (requirement == QRTEntitlementWipeContainer) {
    const plist::Value* value = plist::find(entitlements, QRTEntitlementWipeContainer);
    wipeIdentifiers = value ? stringArray(*value) : std::nullopt;
    if (!wipeIdentifiers) {
      QRTLog(kLogError, "No entitled containers to wipe");
      if (!allowed) return refuse();
    }
  } else if (!requiresNone && !allowed && !entitlementTrue(entitlements, entitlement)) {
    return refuse();
  }
  // The database records the program, whoever runs it; what this caller
  // may do is decided by its own part of the identity.
  registerCallerEntitlements(caller->program ? caller->program : caller);
  rights.masterEntitled = allowed;
  QRTClientConnection client(identity.signingIdentifier, userId, otherIdLookup, std::move(wipeIdentifiers));
  client.setRights(rights);
  return client;
}

namespace {

// Every identifier a request names: the program, group and system group
// identifiers a handler may read.
bool requestIdentifiersValid(const plist::Dictionary& request, uint32_t callerUid, uint64_t command) {
  auto check = [&](const char* key, const plist::Value& value) {
    const std::string* identifier = value.stringIf();
    if (!identifier || QRTIdentifierIsValid(*identifier)) return true;
    QRTLogRefusal(callerUid, "Invalid %s %@ (%llu bytes) in command %llu from client %u", key,
                  platform::logIdentifier(*identifier), static_cast<unsigned long long>(identifier->size()),
                  static_cast<unsigned long long>(command), callerUid);
    return false;
  };
  for (const char* key : {QRTKeyIdentifier, QRTKeyGroupIdentifier, QRTKeyOldIdentifier, QRTKeyNewIdentifier}) {
    if (const plist::Value* value = plist::find(request, key); value && !check(key, *value)) return false;
  }
  if (const plist::Value* list = plist::find(request, QRTKeyIdentifiersArray); list && list->arrayIf()) {
    for (const plist::Value& item : list->array())
      if (!check(QRTKeyIdentifiersArray, item)) return false;
  }
  return true;
}

}  // namespace
