// Request handler of the store's check and repair (command 100).
#pragma once

#include "Daemon/requests/QRTMessage.h"

// Runs on a serial queue of its own, one check at a time, and answers when done.
void QRTHandleVerify(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                     uint64_t* result);
