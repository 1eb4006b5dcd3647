#include "Daemon/requests/QRTCodeSigningCommands.h"

#include <algorithm>

#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/groups/QRTGroupManager.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTWhitelist.h"
#include "platform/Log.h"

using platform::kLogError;

namespace {

constexpr const char* kQuietSystemGroup = "systemgroup.com.norvane.sharedpclogging";

// The service, or nothing with result 66 when its database could not be opened.
QRTCodeSigningMapping* mappingOr66(uint64_t* result) {
  QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance();
  if (!mapping) *result = QRTErrorDatabase;
  return mapping;
}

plist::Dictionary pathDictionary(const std::map<std::string, std::string>& paths) {
  plist::Dictionary dictionary;
  for (const auto& [group, path] : paths) dictionary.emplace(group, path);
  return dictionary;
}

void replyGroupPaths(uint32_t userId, const plist::Dictionary& request, const QRTReplyRef& reply,
                     QRTClientConnection& client, QRTCodeSigningMapping* mapping, uint64_t* result) {
  auto paths = QRTGroupManager::defaultManager().groupContainerPathsForUser(
      userId, client, QRTMessageIdentifier(request, client.clientBundleIdentifier()), mapping, result);
  if (paths) reply->dictionary[QRTReplyKeyGroupContainerDict] = pathDictionary(*paths);
}

// A key that is present must hold a dictionary: a mistyped info read as
// "none" would delete the program's entry.
bool dictionaryOrAbsent(const plist::Dictionary& request, const char* key, const plist::Dictionary** out) {
  const plist::Value* value = QRTMessageObject(request, key);
  *out = value ? value->dictionaryIf() : nullptr;
  if (!value || *out) return true;
  QRTLog(kLogError, "%s of %@ is not a dictionary; nothing changed", key, QRTMessageString(request, QRTKeyIdentifier));
  return false;
}

}  // namespace

void QRTHandleGroupContainerPaths(const plist::Dictionary& request, const QRTReplyRef& reply,
                                  QRTClientConnection& client, uint64_t* result) {
  uint32_t userId = 0;
  auto requested = static_cast<uint32_t>(QRTMessageU64(request, QRTKeyUserID));
  if (!validateUserId(requested, QRTClassAppGroup, client, &userId, result)) return;
  QRTCodeSigningMapping* mapping = mappingOr66(result);
  if (!mapping) return;
  replyGroupPaths(userId, request, reply, client, mapping, result);
}

void QRTHandleGroupContainerIdentifiers(const plist::Dictionary& request, const QRTReplyRef& reply,
                                        QRTClientConnection& client, uint64_t* result) {
  uint32_t userId = 0;
  auto requested = static_cast<uint32_t>(QRTMessageU64(request, QRTKeyUserID));
  if (!validateUserId(requested, QRTClassAppGroup, client, &userId, result)) return;
  QRTCodeSigningMapping* mapping = mappingOr66(result);
  if (!mapping) return;
  auto identifiers = QRTGroupManager::defaultManager().groupContainerIdentifiersForUser(
      userId, QRTMessageIdentifier(request, client.clientBundleIdentifier()), mapping, result);
  if (identifiers)
    reply->dictionary[QRTReplyKeyGroupIdentifiersArray] = plist::Array(identifiers->begin(), identifiers->end());
}

void QRTHandleSystemGroupContainerPaths(const plist::Dictionary& request, const QRTReplyRef& reply,
                                        QRTClientConnection& client, uint64_t* result) {
  QRTCodeSigningMapping* mapping = mappingOr66(result);
  if (!mapping) return;
  replyGroupPaths(QRTSystemContainerUserId, request, reply, client, mapping, result);
}

void QRTHandleSystemGroupContainerPath(const plist::Dictionary& request, const QRTReplyRef& reply,
                                       QRTClientConnection& client, uint64_t* result) {
  QRTCodeSigningMapping* mapping = mappingOr66(result);
  if (!mapping) return;
  const std::optional<std::string>& caller = client.clientBundleIdentifier();
  const std::optional<std::string> identifier = QRTMessageIdentifier(request, caller);
  const std::optional<std::string> group = QRTMessageString(request, QRTKeyGroupIdentifier);
  // Entitlement is judged by the caller's own identifier, whatever it names,
  // and counts only for a caller whose uid may hold system-level entitlements.
  const QRTGroupList entitled =
      caller && client.rights().systemEntitled ? mapping->systemGroupIdentifiersForIdentifier(*caller) : std::nullopt;
  std::optional<std::string> path;
  if (group && entitled && std::find(entitled->begin(), entitled->end(), *group) != entitled->end()) {
    auto paths = QRTGroupManager::defaultManager().groupContainerPathsForUser(QRTSystemContainerUserId, client,
                                                                              identifier, mapping, result);
    if (paths) {
      if (auto it = paths->find(*group); it != paths->end()) path = it->second;
    }
  } else if ((group && QRTWhitelist::sharedWhitelist().systemGroupContainerIdIsWellknown(*group)) ||
             client.allowGroupIdLookup()) {
    client.setAllowGroupIdLookup(true);
    auto metadata =
        client.createOrLookupContainerForUser({QRTSystemContainerUserId, QRTClassSystemGroup, group},
                                              QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, result);
    if (metadata) path = metadata->url().path();
  } else {
    if (group != kQuietSystemGroup) {
      plist::Array list;
      if (entitled) list.assign(entitled->begin(), entitled->end());
      QRTLogRefusal(client.clientUserId(), "%@ is not entitled for system group identifier: %@.  Only entitled for: %@",
                    caller, group, plist::Value(std::move(list)));
    }
    *result = QRTErrorNotEntitled;
    return;
  }
  if (!path) {
    QRTLog(kLogError, "Did not find system group container with identifier: %@ for %@", group, identifier);
    *result = QRTErrorNotFound;
    return;
  }
  reply->dictionary[QRTReplyKeyPath] = *path;
}

void QRTHandleProcessCodeSigningInfo(const plist::Dictionary& request, const QRTReplyRef&, QRTClientConnection&,
                                     uint64_t* result) {
  QRTCodeSigningMapping* mapping = mappingOr66(result);
  if (!mapping) return;
  const plist::Dictionary* info = nullptr;
  const plist::Dictionary* options = nullptr;
  if (!dictionaryOrAbsent(request, "CodeSigningInfo", &info) ||
      !dictionaryOrAbsent(request, "OptionsDictionary", &options)) {
    *result = QRTErrorInvalidArgument;
    return;
  }
  uint64_t code = mapping->processCodeSigningInfo(info, QRTMessageString(request, QRTKeyIdentifier), options);
  if (code != QRTErrorNone) *result = code;
}

void QRTHandleCodeSigningInfoForIdentifier(const plist::Dictionary& request, const QRTReplyRef& reply,
                                           QRTClientConnection&, uint64_t* result) {
  QRTCodeSigningMapping* mapping = mappingOr66(result);
  if (!mapping) return;
  std::optional<plist::Dictionary> info =
      mapping->getCodeSigningInfoForIdentifier(QRTMessageString(request, QRTKeyIdentifier));
  if (!info) {
    *result = QRTErrorNotFound;
    return;
  }
  reply->dictionary[QRTReplyKeyInfoDictionary] = std::move(*info);
}

void QRTHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer(const plist::Dictionary&, const QRTReplyRef&,
                                                                     QRTClientConnection&, uint64_t* result) {
  QRTCodeSigningMapping* mapping = mappingOr66(result);
  if (!mapping) return;
  uint64_t code = mapping->invalidateCodeSigningInfoForAppsWithoutBundleContainer();
  if (code != QRTErrorNone) *result = code;
}
