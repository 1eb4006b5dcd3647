// Request handlers of the special commands: the data migration, the retry test, shared content,
// the network extension and user-managed assets.
#pragma once

#include "Daemon/requests/QRTMessage.h"

void QRTHandlePerformDataMigration(const plist::Dictionary& request, const QRTReplyRef& reply,
                                   QRTClientConnection& client, uint64_t* result);
void QRTHandleRetryTest(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection& client,
                        uint64_t* result);
void QRTHandleStageSharedContent(const plist::Dictionary& request, const QRTReplyRef& reply,
                                 QRTClientConnection& client, uint64_t* result);
void QRTHandleSetNetworkExtension(const plist::Dictionary& request, const QRTReplyRef& reply,
                                  QRTClientConnection& client, uint64_t* result);
void QRTHandleUserManagedAssetsPath(const plist::Dictionary& request, const QRTReplyRef& reply,
                                    QRTClientConnection& client, uint64_t* result);
void QRTHandleDeleteUserManagedAsset(const plist::Dictionary& request, const QRTReplyRef& reply,
                                     QRTClientConnection& client, uint64_t* result);
