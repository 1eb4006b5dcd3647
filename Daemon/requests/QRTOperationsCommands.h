// Request handlers of the administrative commands: the daemon's status, its
// metrics and the log level of the running daemon.
#pragma once

#include <string>

#include "Daemon/requests/QRTMessage.h"

void QRTHandleStatus(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                     uint64_t* result);
void QRTHandleMetrics(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                      uint64_t* result);
void QRTHandleSetLogLevel(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                          uint64_t* result);

// The service manager's status line: requests served and failed, their p99,
// and the death-row backlog as the last pass left it.
std::string QRTServiceStatusLine();
