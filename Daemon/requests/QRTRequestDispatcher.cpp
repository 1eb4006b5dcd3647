#include "Daemon/requests/QRTRequestDispatcher.h"

#include <mutex>
#include <unordered_map>

#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/requests/QRTCodeSigningCommands.h"
#include "Daemon/requests/QRTContainerCommands.h"
#include "Daemon/requests/QRTDataProtectionCommands.h"
#include "Daemon/requests/QRTSpecialCommands.h"
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

void QRTReply::send(uint64_t code) {
  dictionary[QRTReplyKeyError] = code;
  const platform::SendResult sent = connection_->send(messageId_, dictionary);
  done();
  if (sent != platform::SendResult::TooLarge) return;
  // The stream stays whole: the client gets an error in place of the reply.
  QRTLog(kLogError, "Reply to message %llu with code %llu does not fit in one frame; answering %llu",
         static_cast<unsigned long long>(messageId_), static_cast<unsigned long long>(code),
         static_cast<unsigned long long>(QRTErrorException));
  connection_->send(messageId_, plist::Dictionary{{QRTReplyKeyError, static_cast<uint64_t>(QRTErrorException)}});
}

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
#undef SERVED

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
  if (command >= QRTCommandCount) {
    QRTLog(kLogError, "Invalid command index: %lld", static_cast<long long>(command));
    result = QRTErrorInvalidRequest;
  } else {
    const QRTCommandRow& row = QRTCommandTable[command];
    std::optional<QRTClientConnection> client = checkEntitlementsAndInitClientObject(*connection, row.entitlement);
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
  if (!handled || QRTCommandTable[command].replyOnReturn == 1 || result != QRTErrorNone) reply->send(result);
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

void QRTLogEntitlementRefusal(uint32_t callerUid, int pid, const std::optional<std::string>& signingIdentifier,
                              const char* entitlement) {
  platform::logRefusal(
      callerUid, "checkEntitlementsAndInitClientObject",
      QRTFormat("connection attempt from pid %d (%@) missing required entitlement: %s", pid,
                signingIdentifier ? std::optional(platform::logIdentifier(*signingIdentifier)) : std::nullopt,
                entitlement));
}

bool validateUserId(uint32_t requestedUserId, uint64_t containerClass, uint32_t callerUserId, bool systemProcess,
                    uint32_t* effectiveUserId, uint64_t* result) {
  bool valid;
  uint32_t effective = requestedUserId;
  if (QRTIsBundleClass(containerClass)) {
    valid = requestedUserId == QRTInstallerUserId;
    effective = QRTInstallerUserId;
  } else if (QRTIsSystemClass(containerClass)) {
    valid = requestedUserId == QRTSystemContainerUserId;
  } else if (!systemProcess || callerUserId >= platform::ordinaryUserMinimum()) {
    // Anyone may connect, whatever their uid: only root and the holders of
    // system-level entitlements act for other users.
    valid = requestedUserId == callerUserId || requestedUserId == 1;
    effective = callerUserId;
  } else if (requestedUserId == 1) {
    effective = QRTGlobalConfiguration::sharedInstance().currentMobileUserId();
    valid = effective != QRTGlobalConfiguration::kNoDefaultUser;
  } else {
    valid = user_id_valid_for_class(containerClass, requestedUserId);
  }
  if (!valid) {
    if (result) {
      QRTLogRefusal(callerUserId, "Invalid userId %u for class %llu from client %u", requestedUserId,
                    static_cast<unsigned long long>(containerClass), callerUserId);
      *result = QRTErrorInvalidArgument;
    }
    return false;
  }
  if (effectiveUserId) *effectiveUserId = effective;
  return true;
}

bool validateUserId(uint32_t requestedUserId, uint64_t containerClass, const QRTClientConnection& client,
                    uint32_t* effectiveUserId, uint64_t* result) {
  return validateUserId(requestedUserId, containerClass, client.clientUserId(), client.rights().systemProcess,
                        effectiveUserId, result);
}

bool QRTIdentifierIsValid(std::string_view identifier) {
  if (identifier.empty() || identifier.size() > kQRTIdentifierMaxBytes) return false;
  for (size_t i = 0; i < identifier.size();) {
    const auto c = static_cast<unsigned char>(identifier[i]);
    if (c < 0x20 || c == 0x7f) return false;
    if (c < 0x80) {
      ++i;
      continue;
    }
    // Shortest-form UTF-8 of a scalar value; C1 controls are controls too.
    size_t length = c >= 0xc2 && c <= 0xdf ? 2 : c >= 0xe0 && c <= 0xef ? 3 : c >= 0xf0 && c <= 0xf4 ? 4 : 0;
    if (length == 0 || i + length > identifier.size()) return false;
    uint32_t value = c & (0x7f >> length);
    for (size_t k = 1; k < length; ++k) {
      const auto next = static_cast<unsigned char>(identifier[i + k]);
      if ((next & 0xc0) != 0x80) return false;
      value = value << 6 | (next & 0x3f);
    }
    if ((length == 3 && (value < 0x800 || (value >= 0xd800 && value <= 0xdfff))) ||
        (length == 4 && (value < 0x10000 || value > 0x10ffff)) || (value >= 0x80 && value <= 0x9f))
      return false;
    i += length;
  }
  return true;
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

uint64_t QRTMessageU64(const plist::Dictionary& message, std::string_view key) {
  const plist::Value* v = plist::find(message, key);
  const plist::Integer* i = v ? v->integerIf() : nullptr;
  return i ? i->asUnsigned() : 0;
}

int64_t QRTMessageI64(const plist::Dictionary& message, std::string_view key) {
  const plist::Value* v = plist::find(message, key);
  const plist::Integer* i = v ? v->integerIf() : nullptr;
  return i ? i->asSigned() : 0;
}

bool QRTMessageBool(const plist::Dictionary& message, std::string_view key) {
  const plist::Value* v = plist::find(message, key);
  const bool* b = v ? v->booleanIf() : nullptr;
  return b && *b;
}

std::optional<std::string> QRTMessageString(const plist::Dictionary& message, std::string_view key) {
  const plist::Value* v = plist::find(message, key);
  const std::string* s = v ? v->stringIf() : nullptr;
  return s ? std::optional<std::string>(*s) : std::nullopt;
}

std::optional<QRTUUID> QRTMessageUUID(const plist::Dictionary& message, std::string_view key) {
  const plist::Value* v = plist::find(message, key);
  const plist::Data* d = v ? v->dataIf() : nullptr;
  return d ? QRTUUID::fromBytes(d->data(), d->size()) : std::nullopt;
}

const plist::Value* QRTMessageObject(const plist::Dictionary& message, std::string_view key) {
  return plist::find(message, key);
}

std::optional<std::string> QRTMessageIdentifier(const plist::Dictionary& message,
                                                const std::optional<std::string>& clientIdentifier) {
  // A mistyped identifier reads as missing, as every reader treats a wrong type.
  if (std::optional<std::string> identifier = QRTMessageString(message, QRTKeyIdentifier)) return identifier;
  return clientIdentifier;
}
