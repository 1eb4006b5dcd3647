#include "Daemon/requests/QRTDataProtectionCommands.h"

#include <cstdint>
#include <limits>

#include "Daemon/QRTProcessWide.h"
#include "Daemon/dataprotection/QRTDataProtectionManager.h"
#include "platform/Log.h"

void QRTHandleSetDataProtection(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                                uint64_t* result) {
  const uint64_t containerClass = QRTMessageU64(request, QRTKeyContainerClass);
  uint32_t userId = 0;
  const auto requested = static_cast<uint32_t>(QRTMessageU64(request, QRTKeyUserID));
  // A failed check leaves the result set: the dispatcher sends the one reply.
  if (!validateUserId(requested, containerClass, client, &userId, result)) return;
  const int64_t protectionClass = QRTMessageI64(request, QRTKeyDataProtectionClass);
  if (protectionClass < std::numeric_limits<int32_t>::min() || protectionClass > std::numeric_limits<int32_t>::max()) {
    QRTLog(platform::kLogError, "Data protection class %lld is not allowed", static_cast<long long>(protectionClass));
    *result = QRTErrorInvalidArgument;
    return;
  }
  // From here on the completion sends the one reply and the result stays 1.
  QRTDataProtectionManager::defaultManager().setDataProtectionOnDataContainerForUser(
      userId, QRTMessageString(request, QRTKeyIdentifier), containerClass, static_cast<int32_t>(protectionClass),
      QRTMessageBool(request, QRTKeyIsThirdParty), QRTMessageBool(request, QRTKeyRetryIfLocked), QRTLockStateQueue(),
      [reply](uint64_t code) { reply->send(code); });
}
