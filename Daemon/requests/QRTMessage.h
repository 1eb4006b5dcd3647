// What a request handler reads and answers with: the message readers, the
// reply, and the checks every handler makes of the identifiers and the user
// a request names.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/PlistValue.h"
#include "base/QRTProtocol.h"
#include "base/QRTUUID.h"
#include "Daemon/QRTMetrics.h"
#include "Daemon/store/QRTClientConnection.h"
#include "platform/RequestSocket.h"

// The reply of one request. Handlers fill dictionary; the commands that finish
// later keep the reply and call send() themselves.
class QRTReply {
 public:
  QRTReply(platform::ConnectionRef connection, uint64_t messageId)
      : connection_(std::move(connection)), messageId_(messageId) {
    connection_->replyDue();
  }
  ~QRTReply() { done(); }
  QRTReply(const QRTReply&) = delete;
  QRTReply& operator=(const QRTReply&) = delete;
  plist::Dictionary dictionary;
  // Stores code under "ReplyError" and sends the reply.
  void send(uint64_t code);
  // Counts the request under its command when the reply goes out, and logs
  // it at debug level with its caller, result and time taken.
  void countAs(uint64_t command, const char* name, uint32_t callerUid, int callerPid) {
    counted_ = true;
    slot_ = QRTMetrics::slotForCommand(command);
    name_ = name;
    callerUid_ = callerUid;
    callerPid_ = callerPid;
  }
  void setCallerIdentifier(std::optional<std::string> identifier) { callerIdentifier_ = std::move(identifier); }

 private:
  void done() {
    if (!done_.exchange(true)) connection_->replyDone();
  }
  platform::ConnectionRef connection_;
  uint64_t messageId_;
  std::atomic<bool> done_{false};
  QRTMetrics::Clock::time_point received_ = QRTMetrics::Clock::now();
  bool counted_ = false;
  size_t slot_ = 0;
  const char* name_ = "";
  uint32_t callerUid_ = 0;
  int callerPid_ = 0;
  std::optional<std::string> callerIdentifier_;
};
using QRTReplyRef = std::shared_ptr<QRTReply>;

// The entitlement refusal line, limited per caller uid like every refusal.
void QRTLogEntitlementRefusal(uint32_t callerUid, int pid, const std::optional<std::string>& signingIdentifier,
                              const char* entitlement);

// Checks a requested user id against the class and the caller; on success
// stores the user id the operation must use. A caller that is not a system
// process (systemProcess false) is checked as an ordinary user's, whatever
// its uid.
bool validateUserId(uint32_t requestedUserId, uint64_t containerClass, uint32_t callerUserId, bool systemProcess,
                    uint32_t* effectiveUserId, uint64_t* result);
bool validateUserId(uint32_t requestedUserId, uint64_t containerClass, const QRTClientConnection& client,
                    uint32_t* effectiveUserId, uint64_t* result);

// A request's program, group or system group identifier: 1 to 255 bytes of
// UTF-8 without control characters.
inline constexpr size_t kQRTIdentifierMaxBytes = 255;
bool QRTIdentifierIsValid(std::string_view identifier);

// Message readers: a missing key, or a value of another type, reads as 0,
// false or nothing.
uint64_t QRTMessageU64(const plist::Dictionary& message, std::string_view key);
int64_t QRTMessageI64(const plist::Dictionary& message, std::string_view key);
bool QRTMessageBool(const plist::Dictionary& message, std::string_view key);
std::optional<std::string> QRTMessageString(const plist::Dictionary& message, std::string_view key);
std::optional<QRTUUID> QRTMessageUUID(const plist::Dictionary& message, std::string_view key);
const plist::Value* QRTMessageObject(const plist::Dictionary& message, std::string_view key);
// "Identifier", or the caller's own identifier when the key is missing or not a string.
std::optional<std::string> QRTMessageIdentifier(const plist::Dictionary& message,
                                                const std::optional<std::string>& clientIdentifier);
