#include "Daemon/requests/QRTContainerCommands.h"

#include <algorithm>

#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTWhitelist.h"
#include "platform/Log.h"

namespace {

plist::Data uuidData(const QRTUUID& uuid) { return plist::Data(uuid.bytes().begin(), uuid.bytes().end()); }

// The user id the operation runs for, or nothing when the check failed.
std::optional<uint32_t> checkedUser(const plist::Dictionary& request, uint64_t containerClass,
                                    const QRTClientConnection& client, uint64_t* result) {
  uint32_t effective = 0;
  auto requested = static_cast<uint32_t>(QRTMessageU64(request, QRTKeyUserID));
  if (!validateUserId(requested, containerClass, client, &effective, result)) return std::nullopt;
  return effective;
}

// Bundle and system group containers are global: anyone may connect, so they
// need the entitlement that makes them, before anything is made, looked up or
// sent to death row.
bool globalClassEntitled(uint64_t containerClass, const std::optional<std::string>& identifier,
                         const QRTClientConnection& client, uint64_t* result) {
  const char* needed = nullptr;
  if (QRTIsBundleClass(containerClass)) {
    if (!client.rights().masterEntitled) needed = QRTEntitlementAllowed;
  } else if (containerClass == QRTClassSystemGroup && !client.rights().masterEntitled) {
    // The same system-group entitlement that command 17 asks for.
    QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance();
    const std::optional<std::string>& caller = client.clientBundleIdentifier();
    const QRTGroupList entitled = mapping && caller && client.rights().systemEntitled
                                      ? mapping->systemGroupIdentifiersForIdentifier(*caller)
                                      : std::nullopt;
    if (!identifier || !entitled || std::find(entitled->begin(), entitled->end(), *identifier) == entitled->end())
      needed = "com.norvane.security.system-groups";
  }
  if (!needed) return true;
  QRTLogEntitlementRefusal(client.clientUserId(), client.rights().pid, client.clientBundleIdentifier(), needed);
  *result = QRTErrorNotEntitled;
  return false;
}

}  // namespace

void QRTHandleCreateOrLookupContainer(const plist::Dictionary& request, const QRTReplyRef& reply,
                                      QRTClientConnection& client, uint64_t* result) {
  uint64_t containerClass = QRTMessageU64(request, QRTKeyContainerClass);
  if (!globalClassEntitled(containerClass, QRTMessageIdentifier(request, client.clientBundleIdentifier()), client,
                           result))
    return;
  std::optional<uint32_t> userId = checkedUser(request, containerClass, client, result);
  if (!userId) return;
  auto metadata = client.createOrLookupContainerForUser(
      {*userId, containerClass, QRTMessageIdentifier(request, client.clientBundleIdentifier()),
       QRTMessageBool(request, QRTKeyTransient)},
      QRTMessageBool(request, QRTKeyCreateIfNecessary) ? QRTCreateMode::CreateIfMissing : QRTCreateMode::LookupOnly,
      QRTLocking::TakeLocks, result);
  if (!metadata) return;
  reply->dictionary[QRTReplyKeyUUID] = uuidData(metadata->uuid());
  reply->dictionary[QRTReplyKeyExisted] = metadata->existed();
  reply->dictionary[QRTReplyKeyPath] = metadata->url().path();
  reply->dictionary[QRTReplyKeyIdentifier] = metadata->identifier();
}

void QRTHandleSystemContainerPath(const plist::Dictionary& request, const QRTReplyRef& reply,
                                  QRTClientConnection& client, uint64_t* result) {
  std::optional<std::string> identifier = QRTMessageIdentifier(request, client.clientBundleIdentifier());
  // Well-known system containers are open to every caller.
  if (identifier && identifier != client.clientBundleIdentifier() && !client.allowOtherIdLookup() &&
      QRTWhitelist::sharedWhitelist().systemContainerIdIsWellknown(*identifier)) {
    client.setAllowOtherIdLookup(true);
  }
  auto metadata = client.createOrLookupContainerForUser({QRTSystemContainerUserId, QRTClassSystemData, identifier},
                                                        QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, result);
  if (metadata) reply->dictionary[QRTReplyKeyPath] = metadata->url().path();
}

namespace {

std::optional<uint64_t> classAndUser(const plist::Dictionary& request, const QRTClientConnection& client,
                                     uint64_t* result, uint32_t* userId) {
  uint64_t containerClass = QRTMessageU64(request, QRTKeyContainerClass);
  auto user = checkedUser(request, containerClass, client, result);
  if (!user) return std::nullopt;
  *userId = *user;
  return containerClass;
}

}  // namespace

void QRTHandleContainersForUser(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                                uint64_t* result) {
  uint32_t userId;
  auto containerClass = classAndUser(request, client, result, &userId);
  if (!containerClass) return;
  auto list = client.containersForUser(userId, *containerClass, QRTMessageBool(request, QRTKeyTransient), result);
  if (!list) return;
  plist::Array identifiers, uuids;
  identifiers.reserve(list->size());
  uuids.reserve(list->size());
  for (const auto& metadata : *list) {
    identifiers.emplace_back(metadata->identifier());
    uuids.emplace_back(uuidData(metadata->uuid()));
  }
  reply->dictionary[QRTReplyKeyIdsArray] = std::move(identifiers);
  reply->dictionary[QRTReplyKeyUUIDsArray] = std::move(uuids);
}

void QRTHandleReplaceContainer(const plist::Dictionary& request, const QRTReplyRef&, QRTClientConnection& client,
                               uint64_t* result) {
  std::optional<QRTUUID> oldUUID = QRTMessageUUID(request, QRTKeyOldContainerUUID);
  uint64_t oldClass = 0;
  uint32_t oldUser = 0;
  std::optional<std::string> oldIdentifier;
  if (oldUUID) {
    oldClass = QRTMessageU64(request, QRTKeyOldContainerClass);
    oldIdentifier = QRTMessageString(request, QRTKeyOldIdentifier);
    auto requested = static_cast<uint32_t>(QRTMessageU64(request, QRTKeyOldContainerUserID));
    if (!validateUserId(requested, oldClass, client, &oldUser, result)) return;
  }
  uint64_t newClass = QRTMessageU64(request, QRTKeyNewContainerClass);
  uint32_t newUser = 0;
  auto requested = static_cast<uint32_t>(QRTMessageU64(request, QRTKeyNewContainerUserID));
  if (!validateUserId(requested, newClass, client, &newUser, result)) return;
  client.replaceContainer(oldUUID, QRTMessageUUID(request, QRTKeyNewContainerUUID), oldUser, newUser, oldIdentifier,
                          QRTMessageString(request, QRTKeyNewIdentifier), oldClass, newClass, false, false, result);
}

void QRTHandleStageContainerForDelete(const plist::Dictionary& request, const QRTReplyRef&, QRTClientConnection& client,
                                      uint64_t* result) {
  std::vector<std::optional<uint64_t>> classes;
  std::vector<std::optional<QRTUUID>> uuids;
  if (const plist::Value* v = QRTMessageObject(request, QRTKeyContainerClassesArray); v && v->arrayIf()) {
    for (const plist::Value& item : v->array()) {
      const plist::Integer* i = item.integerIf();
      classes.push_back(i ? std::optional<uint64_t>(i->asUnsigned()) : std::nullopt);
    }
  }
  if (const plist::Value* v = QRTMessageObject(request, QRTKeyUUIDsArray); v && v->arrayIf()) {
    for (const plist::Value& item : v->array()) {
      const plist::Data* d = item.dataIf();
      uuids.push_back(d ? QRTUUID::fromBytes(d->data(), d->size()) : std::nullopt);
    }
  }
  // Each user id is checked against the class at its position; positions
  // past the class list have no class to check against and are not read.
  std::vector<uint32_t> users;
  if (const plist::Value* v = QRTMessageObject(request, QRTKeyUserIDsArray); v && v->arrayIf()) {
    const plist::Array& requested = v->array();
    for (size_t i = 0; i < requested.size() && i < classes.size(); ++i) {
      const plist::Integer* n = requested[i].integerIf();
      uint32_t effective = 0;
      if (!validateUserId(static_cast<uint32_t>(n ? n->asUnsigned() : 0), classes[i].value_or(0), client, &effective,
                          result)) {
        return;
      }
      users.push_back(effective);
    }
  }
  std::vector<std::optional<std::string>> identifiers;
  const plist::Value* ids = QRTMessageObject(request, QRTKeyIdentifiersArray);
  if (ids && ids->arrayIf()) {
    for (const plist::Value& item : ids->array()) {
      identifiers.push_back(item.stringIf() ? std::optional<std::string>(item.string()) : std::nullopt);
    }
  } else {
    QRTLogAs(platform::kLogError, "stageContainerForDelete", "Got non-Array input for the identifiers array");
  }
  client.stageForDeleteContainersWithUsers(users, uuids, identifiers, classes, true, result);
}

void QRTHandleDeleteContainersOnDeathRow(const plist::Dictionary&, const QRTReplyRef& reply,
                                         QRTClientConnection& client, uint64_t*) {
  client.deleteContainersOnDeathRowWithCompletion([reply](uint64_t code) { reply->send(code); });
}

void QRTHandleSetInfoValue(const plist::Dictionary& request, const QRTReplyRef&, QRTClientConnection& client,
                           uint64_t* result) {
  uint32_t userId;
  auto containerClass = classAndUser(request, client, result, &userId);
  if (!containerClass) return;
  const plist::Value* value = QRTMessageObject(request, QRTKeyValue);
  client.setInfoValue(value ? std::optional<plist::Value>(*value) : std::nullopt, QRTMessageString(request, QRTKeyKey),
                      userId, QRTMessageUUID(request, QRTKeyUUID), QRTMessageString(request, QRTKeyIdentifier),
                      *containerClass, true, result);
}

void QRTHandleInfoValueForKey(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                              uint64_t* result) {
  uint32_t userId;
  auto containerClass = classAndUser(request, client, result, &userId);
  if (!containerClass) return;
  auto value = client.infoValueForKey(QRTMessageString(request, QRTKeyKey), userId, QRTMessageUUID(request, QRTKeyUUID),
                                      QRTMessageString(request, QRTKeyIdentifier), *containerClass, true, result);
  if (value) reply->dictionary[QRTReplyKeyInfoValue] = std::move(*value);
}

void QRTHandleMetadataForContainer(const plist::Dictionary& request, const QRTReplyRef& reply,
                                   QRTClientConnection& client, uint64_t* result) {
  uint32_t userId;
  auto containerClass = classAndUser(request, client, result, &userId);
  if (!containerClass) return;
  auto metadata = client.metadataForUser(userId, QRTMessageUUID(request, QRTKeyUUID),
                                         QRTMessageString(request, QRTKeyIdentifier), *containerClass, result);
  if (!metadata) return;
  reply->dictionary[QRTReplyKeyPath] = metadata->url().path();
  reply->dictionary[QRTReplyKeyTransient] = metadata->transient();
  if (QRTMessageBool(request, QRTKeyInfoDictRequested) && metadata->info()) {
    reply->dictionary[QRTReplyKeyInfoDictionary] = *metadata->info();
  }
}

void QRTHandleRecreateDefaultStructure(const plist::Dictionary& request, const QRTReplyRef&,
                                       QRTClientConnection& client, uint64_t* result) {
  uint32_t userId;
  auto containerClass = classAndUser(request, client, result, &userId);
  if (!containerClass) return;
  client.recreateDefaultStructureForUser(userId, QRTMessageUUID(request, QRTKeyUUID),
                                         QRTMessageString(request, QRTKeyIdentifier), *containerClass, result);
}

void QRTHandleRegenerateDirectoryUUID(const plist::Dictionary& request, const QRTReplyRef&, QRTClientConnection& client,
                                      uint64_t* result) {
  uint32_t userId;
  auto containerClass = classAndUser(request, client, result, &userId);
  if (!containerClass) return;
  client.regenerateDirectoryUUIDForUser(userId, QRTMessageUUID(request, QRTKeyUUID),
                                        QRTMessageString(request, QRTKeyIdentifier), *containerClass, result);
}

void QRTHandleDeleteContainer(const plist::Dictionary& request, const QRTReplyRef&, QRTClientConnection& client,
                              uint64_t* result) {
  uint32_t userId;
  auto containerClass = classAndUser(request, client, result, &userId);
  if (!containerClass) return;
  client.deleteContainerForUser(userId, QRTMessageString(request, QRTKeyIdentifier), *containerClass,
                                QRTMessageBool(request, QRTKeyTransient), result);
}

void QRTHandleWipeAddonDataContainer(const plist::Dictionary& request, const QRTReplyRef&, QRTClientConnection& client,
                                     uint64_t* result) {
  // Only the wipe list decides, whatever else the caller may look up.
  client.setAllowOtherIdLookup(false);
  uint32_t userId = 0;
  auto requested = static_cast<uint32_t>(QRTMessageU64(request, QRTKeyUserID));
  if (!validateUserId(requested, QRTClassAddonData, client, &userId, result)) return;
  client.deleteDataContainerContentForUser(userId, QRTMessageString(request, QRTKeyIdentifier), QRTClassAddonData,
                                           result);
}

void QRTHandleDeleteDataContainerContent(const plist::Dictionary& request, const QRTReplyRef&,
                                         QRTClientConnection& client, uint64_t* result) {
  uint32_t userId;
  auto containerClass = classAndUser(request, client, result, &userId);
  if (!containerClass) return;
  client.deleteDataContainerContentForUser(userId, QRTMessageString(request, QRTKeyIdentifier), *containerClass,
                                           result);
}

void QRTHandleDiskUsage(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                        uint64_t* result) {
  uint32_t userId;
  auto containerClass = classAndUser(request, client, result, &userId);
  if (!containerClass) return;
  reply->dictionary[QRTReplyKeyDiskUsage] =
      client.diskUsageForUserId(userId, QRTMessageUUID(request, QRTKeyUUID),
                                QRTMessageString(request, QRTKeyIdentifier), *containerClass, result);
}
