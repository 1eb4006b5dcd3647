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

using platform::kLogError;

void QRTReply::send(uint64_t code) {
  dictionary["ReplyError"] = code;
  const platform::SendResult sent = connection_->send(messageId_, dictionary);
  done();
  if (sent != platform::SendResult::TooLarge) return;
  // The stream stays whole: the client gets an error in place of the reply.
  QRTLog(kLogError, "Reply to message %llu with code %llu does not fit in one frame; answering %llu",
         static_cast<unsigned long long>(messageId_), static_cast<unsigned long long>(code),
         static_cast<unsigned long long>(QRTErrorException));
  connection_->send(messageId_, plist::Dictionary{{"ReplyError", static_cast<uint64_t>(QRTErrorException)}});
}

#define SERVED(n, name, handler, entitlement, flag) {n, name, handler, entitlement, flag}
const QRTCommandRow QRTCommandTable[QRTCommandCount] = {
    SERVED(0, "createOrLookupContainer", QRTHandleCreateOrLookupContainer, QRTEntitlementNone, 1),
    SERVED(1, "containersForUser", QRTHandleContainersForUser, QRTEntitlementAllowed, 1),
    SERVED(2, "replaceContainer", QRTHandleReplaceContainer, QRTEntitlementAllowed, 1),
    SERVED(3, "stageContainerForDelete", QRTHandleStageContainerForDelete, QRTEntitlementAllowed, 1),
    SERVED(4, "deleteContainersOnDeathRow", QRTHandleDeleteContainersOnDeathRow, QRTEntitlementAllowed, 0),
    SERVED(5, "setInfoValue", QRTHandleSetInfoValue, QRTEntitlementAllowed, 1),
    SERVED(6, "infoValueForKey", QRTHandleInfoValueForKey, QRTEntitlementAllowed, 1),
    SERVED(7, "metadataForContainer", QRTHandleMetadataForContainer, QRTEntitlementAllowed, 1),
    SERVED(8, "recreateDefaultStructure", QRTHandleRecreateDefaultStructure, QRTEntitlementAllowed, 1),
    SERVED(9, "regenerateDirectoryUUID", QRTHandleRegenerateDirectoryUUID, QRTEntitlementAllowed, 1),
    SERVED(10, "deleteContainer", QRTHandleDeleteContainer, QRTEntitlementAllowed, 1),
    SERVED(11, "wipeAddonDataContainer", QRTHandleWipeAddonDataContainer, QRTEntitlementWipeContainer, 1),
    SERVED(12, "deleteDataContainerContent", QRTHandleDeleteDataContainerContent, QRTEntitlementAllowed, 1),
    SERVED(13, "groupContainerPaths", QRTHandleGroupContainerPaths, QRTEntitlementNone, 1),
    SERVED(14, "groupContainerIdentifiers", QRTHandleGroupContainerIdentifiers, QRTEntitlementAllowed, 1),
    SERVED(15, "systemContainerPath", QRTHandleSystemContainerPath, QRTEntitlementNone, 1),
    SERVED(16, "systemGroupContainerPaths", QRTHandleSystemGroupContainerPaths, QRTEntitlementNone, 1),
    SERVED(17, "systemGroupContainerPath", QRTHandleSystemGroupContainerPath, QRTEntitlementNone, 1),
    SERVED(18, "processCodeSigningInfo", QRTHandleProcessCodeSigningInfo, QRTEntitlementAllowed, 1),
    SERVED(19, "codeSigningInfoForIdentifier", QRTHandleCodeSigningInfoForIdentifier, QRTEntitlementAllowed, 1),
    SERVED(20, "invalidateCodeSigningInfoForAppsWithoutBundleContainer",
           QRTHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer, QRTEntitlementAllowed, 1),
    SERVED(21, "setDataProtection", QRTHandleSetDataProtection, QRTEntitlementAllowed, 0),
    SERVED(22, "recreateContainerStructure", QRTHandleRecreateDefaultStructure, QRTEntitlementAllowed, 1),
    SERVED(23, "diskUsage", QRTHandleDiskUsage, QRTEntitlementAllowed, 1),
    SERVED(24, "performDataMigration", QRTHandlePerformDataMigration, QRTEntitlementDataMigration, 1),
    SERVED(25, "retryTest", QRTHandleRetryTest, QRTEntitlementAllowed, 1),
    SERVED(26, "stageSharedContent", QRTHandleStageSharedContent, QRTEntitlementStageSharedContent, 1),
    SERVED(27, "setNetworkExtension", QRTHandleSetNetworkExtension, QRTEntitlementNetworkExtension, 1),
    SERVED(28, "userManagedAssetsPath", QRTHandleUserManagedAssetsPath, QRTEntitlementUserManagedAssets, 1),
    SERVED(29, "deleteUserManagedAsset", QRTHandleDeleteUserManagedAsset, QRTEntitlementUserManagedAssets, 1),
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
  uint64_t command = QRTMessageU64(request, "Command");
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
  std::shared_ptr<const platform::CodeIdentity> caller = platform::identityForExecutable(peer ? peer->executable : "");
  const platform::CodeIdentity& identity = *caller;
  if (!peer || peer->executable.empty()) {
    QRTLog(kLogError, "Failed to copy signing ID for pid %d : %@", pid,
           std::string(peer ? "process executable unreadable" : "peer credentials unreadable"));
  }
  const std::string requirement = entitlement;
  const bool requiresNone = requirement == QRTEntitlementNone;
  const uint32_t userId = peer ? peer->uid : UINT32_MAX;
  auto refuse = [&]() -> std::optional<QRTClientConnection> {
    QRTLogAs(kLogError, "checkEntitlementsAndInitClientObject",
             "connection attempt from pid %d (%@) missing required entitlement: %s", pid, identity.signingIdentifier,
             entitlement);
    return std::nullopt;
  };
  if (!identity.entitlements || identity.entitlements->empty()) {
    if (!requiresNone) return refuse();
    return QRTClientConnection(identity.signingIdentifier, userId, false, std::nullopt);
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
  registerCallerEntitlements(caller);
  return QRTClientConnection(identity.signingIdentifier, userId, otherIdLookup, std::move(wipeIdentifiers));
}

bool validateUserId(uint32_t requestedUserId, uint64_t containerClass, uint32_t callerUserId,
                    uint32_t* effectiveUserId, uint64_t* result) {
  bool valid;
  uint32_t effective = requestedUserId;
  if (QRTIsBundleClass(containerClass)) {
    valid = requestedUserId == QRTInstallerUserId;
    effective = QRTInstallerUserId;
  } else if (QRTIsSystemClass(containerClass)) {
    valid = requestedUserId == QRTSystemContainerUserId;
  } else if (callerUserId > 500) {
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
      QRTLog(kLogError, "Invalid userId %u for class %llu from client %u", requestedUserId,
             static_cast<unsigned long long>(containerClass), callerUserId);
      *result = QRTErrorInvalidArgument;
    }
    return false;
  }
  if (effectiveUserId) *effectiveUserId = effective;
  return true;
}

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
  if (std::optional<std::string> identifier = QRTMessageString(message, "Identifier")) return identifier;
  return clientIdentifier;
}
