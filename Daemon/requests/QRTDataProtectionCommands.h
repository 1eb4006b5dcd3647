// Request handler of the protection-class change (command 21): its reply is
// sent by the change's completion, possibly after the next unlock.
#pragma once

#include "Daemon/requests/QRTMessage.h"

void QRTHandleSetDataProtection(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                                uint64_t* result);
