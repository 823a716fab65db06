// The handlers of the delete, replace, death-row and wipe commands.
#pragma once

#include "core/QRVCommandTable.h"

void QRVHandleReplaceContainer(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                               QRVClientConnection& connection, uint64_t* result);
void QRVHandleStageContainerForDelete(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                      QRVClientConnection& connection, uint64_t* result);
// Answers from the death-row queue once death row is empty.
void QRVHandleDeleteContainersOnDeathRow(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                         QRVClientConnection& connection, uint64_t* result);
void QRVHandleDeleteContainer(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                              QRVClientConnection& connection, uint64_t* result);
void QRVHandleWipeContainerContent(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                   QRVClientConnection& connection, uint64_t* result);
void QRVHandleDeleteContainerContent(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                     QRVClientConnection& connection, uint64_t* result);
