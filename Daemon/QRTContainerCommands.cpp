#include "Daemon/QRTContainerCommands.h"

#include "Daemon/QRTContentClass.h"
#include "Daemon/QRTMetadata.h"
#include "Daemon/QRTWhitelist.h"

namespace {

plist::Data uuidData(const QRTUUID& uuid) { return plist::Data(uuid.bytes().begin(), uuid.bytes().end()); }

// The user id the operation runs for, or nothing when the check failed.
std::optional<uint32_t> checkedUser(const plist::Dictionary& request, uint64_t containerClass,
                                    const QRTClientConnection& client, uint64_t* result) {
  uint32_t effective = 0;
  auto requested = static_cast<uint32_t>(QRTMessageU64(request, "UserID"));
  if (!validateUserId(requested, containerClass, client.clientUserId(), &effective, result)) return std::nullopt;
  return effective;
}

}  // namespace

void QRTHandleCreateOrLookupContainer(const plist::Dictionary& request, const QRTReplyRef& reply,
                                      QRTClientConnection& client, uint64_t* result) {
  uint64_t containerClass = QRTMessageU64(request, "ContainerClass");
  std::optional<uint32_t> userId = checkedUser(request, containerClass, client, result);
  if (!userId) return;
  auto metadata = client.createOrLookupContainerForUser(
      *userId, QRTMessageIdentifier(request, client.clientBundleIdentifier()),
      QRTMessageBool(request, "CreateIfNecessary"), containerClass, QRTMessageBool(request, "Transient"), true, result);
  if (!metadata) return;
  reply->dictionary["ReplyUUID"] = uuidData(metadata->uuid());
  reply->dictionary["ReplyExisted"] = metadata->existed();
  reply->dictionary["ReplyPath"] = metadata->url().path();
  reply->dictionary["ReplyIdentifier"] = metadata->identifier();
}

void QRTHandleSystemContainerPath(const plist::Dictionary& request, const QRTReplyRef& reply,
                                  QRTClientConnection& client, uint64_t* result) {
  std::optional<std::string> identifier = QRTMessageIdentifier(request, client.clientBundleIdentifier());
  // Well-known system containers are open to every caller.
  if (identifier && identifier != client.clientBundleIdentifier() && !client.allowOtherIdLookup() &&
      QRTWhitelist::sharedWhitelist().systemContainerIdIsWellknown(*identifier)) {
    client.setAllowOtherIdLookup(true);
  }
  auto metadata = client.createOrLookupContainerForUser(QRTSystemContainerUserId, identifier, true, QRTClassSystemData,
                                                        false, true, result);
  if (metadata) reply->dictionary["ReplyPath"] = metadata->url().path();
}
