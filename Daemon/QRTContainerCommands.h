// Request handlers of the container commands: each reads its message keys,
// checks the user, calls one container operation and writes the reply keys.
#pragma once

#include "Daemon/QRTRequestDispatcher.h"

void QRTHandleCreateOrLookupContainer(const plist::Dictionary& request, const QRTReplyRef& reply,
                                      QRTClientConnection& client, uint64_t* result);
void QRTHandleSystemContainerPath(const plist::Dictionary& request, const QRTReplyRef& reply,
                                  QRTClientConnection& client, uint64_t* result);
