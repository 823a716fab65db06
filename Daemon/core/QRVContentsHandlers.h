// The handlers of the commands that work inside one container: info values,
// disk usage, a new directory UUID, user-managed assets and shared content.
#pragma once

#include "core/QRVCommandTable.h"

void QRVHandleSetInfoValue(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                           QRVClientConnection& connection, uint64_t* result);
void QRVHandleInfoValueForKey(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                              QRVClientConnection& connection, uint64_t* result);
void QRVHandleRegenerateDirectoryUUID(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                      QRVClientConnection& connection, uint64_t* result);
void QRVHandleDiskUsage(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                        QRVClientConnection& connection, uint64_t* result);
void QRVHandleStageSharedContent(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                 QRVClientConnection& connection, uint64_t* result);
void QRVHandleUserManagedAssetsPath(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                    QRVClientConnection& connection, uint64_t* result);
void QRVHandleDeleteUserManagedAsset(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                     QRVClientConnection& connection, uint64_t* result);
