// The handlers of the create, look-up and listing commands.
#pragma once

#include "core/QRVCommandTable.h"

void QRVHandleCreateOrLookupContainer(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                      QRVClientConnection& connection, uint64_t* result);
void QRVHandleContainersWithClass(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                  QRVClientConnection& connection, uint64_t* result);
void QRVHandleContainerMetadata(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                QRVClientConnection& connection, uint64_t* result);
// Commands 8 and 22 alike.
void QRVHandleRecreateDefaultStructure(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                       QRVClientConnection& connection, uint64_t* result);
