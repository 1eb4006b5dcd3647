// The request layer: turns each message on the request socket into one call
// of a command handler, after checking the caller's entitlements, and sends
// the reply with its "ReplyError".
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "Daemon/requests/QRTMessage.h"
#include "Daemon/store/QRTClientConnection.h"
#include "platform/RequestSocket.h"

using QRTRequestHandler = void (*)(const plist::Dictionary& request, const QRTReplyRef& reply,
                                   QRTClientConnection& client, uint64_t* result);

struct QRTCommandRow {
  QRTCommand command;
  const char* name;
  QRTRequestHandler handler;
  const char* entitlement;
  uint32_t replyOnReturn;
};

extern const QRTCommandRow QRTCommandTable[QRTCommandCount];
// The row of a command, in either table; nothing for a number neither holds.
const QRTCommandRow* QRTCommandRowFor(uint64_t command);

// The handler of every event on a client connection.
void QRTProcessRelayEvent(const platform::ConnectionRef& connection, platform::RequestEvent& event);

// The caller's client object when it holds the entitlement, else nothing.
std::optional<QRTClientConnection> checkEntitlementsAndInitClientObject(const platform::RequestConnection& connection,
                                                                        const char* entitlement);
