// Request handlers of the group container and code-signing commands: the
// group container paths and identifiers of a program, one system group
// container, and the registration, look-up and invalidation of code-signing
// information.
#pragma once

#include "Daemon/requests/QRTMessage.h"

void QRTHandleGroupContainerPaths(const plist::Dictionary& request, const QRTReplyRef& reply,
                                  QRTClientConnection& client, uint64_t* result);
void QRTHandleGroupContainerIdentifiers(const plist::Dictionary& request, const QRTReplyRef& reply,
                                        QRTClientConnection& client, uint64_t* result);
void QRTHandleSystemGroupContainerPaths(const plist::Dictionary& request, const QRTReplyRef& reply,
                                        QRTClientConnection& client, uint64_t* result);
void QRTHandleSystemGroupContainerPath(const plist::Dictionary& request, const QRTReplyRef& reply,
                                       QRTClientConnection& client, uint64_t* result);
void QRTHandleProcessCodeSigningInfo(const plist::Dictionary& request, const QRTReplyRef& reply,
                                     QRTClientConnection& client, uint64_t* result);
void QRTHandleCodeSigningInfoForIdentifier(const plist::Dictionary& request, const QRTReplyRef& reply,
                                           QRTClientConnection& client, uint64_t* result);
void QRTHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer(const plist::Dictionary& request,
                                                                     const QRTReplyRef& reply,
                                                                     QRTClientConnection& client, uint64_t* result);
