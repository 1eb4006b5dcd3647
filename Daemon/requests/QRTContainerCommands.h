// Request handlers of the container commands: each reads its message keys,
// checks the user, calls one container operation and writes the reply keys.
#pragma once

#include "Daemon/requests/QRTMessage.h"

void QRTHandleCreateOrLookupContainer(const plist::Dictionary& request, const QRTReplyRef& reply,
                                      QRTClientConnection& client, uint64_t* result);
void QRTHandleSystemContainerPath(const plist::Dictionary& request, const QRTReplyRef& reply,
                                  QRTClientConnection& client, uint64_t* result);
void QRTHandleContainersForUser(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                                uint64_t* result);
void QRTHandleReplaceContainer(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                               uint64_t* result);
void QRTHandleStageContainerForDelete(const plist::Dictionary& request, const QRTReplyRef& reply,
                                      QRTClientConnection& client, uint64_t* result);
void QRTHandleDeleteContainersOnDeathRow(const plist::Dictionary& request, const QRTReplyRef& reply,
                                         QRTClientConnection& client, uint64_t* result);
void QRTHandleSetInfoValue(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                           uint64_t* result);
void QRTHandleInfoValueForKey(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                              uint64_t* result);
void QRTHandleMetadataForContainer(const plist::Dictionary& request, const QRTReplyRef& reply,
                                   QRTClientConnection& client, uint64_t* result);
void QRTHandleRecreateDefaultStructure(const plist::Dictionary& request, const QRTReplyRef& reply,
                                       QRTClientConnection& client, uint64_t* result);
void QRTHandleRegenerateDirectoryUUID(const plist::Dictionary& request, const QRTReplyRef& reply,
                                      QRTClientConnection& client, uint64_t* result);
void QRTHandleDeleteContainer(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                              uint64_t* result);
void QRTHandleWipeAddonDataContainer(const plist::Dictionary& request, const QRTReplyRef& reply,
                                     QRTClientConnection& client, uint64_t* result);
void QRTHandleDeleteDataContainerContent(const plist::Dictionary& request, const QRTReplyRef& reply,
                                         QRTClientConnection& client, uint64_t* result);
void QRTHandleDiskUsage(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                        uint64_t* result);
