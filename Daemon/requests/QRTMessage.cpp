#include "Daemon/requests/QRTMessage.h"

#include "base/QRTFormat.h"
#include "Daemon/QRTError.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "platform/Log.h"
#include "platform/UserDatabase.h"

using platform::kLogError;

void QRTReply::send(uint64_t code) {
  dictionary[QRTReplyKeyError] = code;
  const platform::SendResult sent = connection_->send(messageId_, dictionary);
  done();
  if (counted_) {
    const uint64_t micros = QRTMetrics::microsSince(received_);
    QRTMetrics::requests(slot_).record(micros, code != QRTErrorNone);
    QRTLogAs(platform::kLogDebug, "QRTProcessRelayEvent", "Served %s for uid %u pid %d (%@): %llu in %llu us", name_,
             callerUid_, callerPid_, callerIdentifier_, static_cast<unsigned long long>(code),
             static_cast<unsigned long long>(micros));
  }
  if (sent != platform::SendResult::TooLarge) return;
  // The stream stays whole: the client gets an error in place of the reply.
  QRTLog(kLogError, "Reply to message %llu with code %llu does not fit in one frame; answering %llu",
         static_cast<unsigned long long>(messageId_), static_cast<unsigned long long>(code),
         static_cast<unsigned long long>(QRTErrorException));
  connection_->send(messageId_, plist::Dictionary{{QRTReplyKeyError, static_cast<uint64_t>(QRTErrorException)}});
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
