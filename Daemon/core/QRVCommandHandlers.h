// The handlers of the command table. Each unpacks its arguments, calls one
// operation, and writes its results into the reply.
#pragma once

#include "core/QRVCommandTable.h"

void QRVHandleRetryTest(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                        QRVClientConnection& connection, uint64_t* result);
void QRVHandleSetTestLock(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                          QRVClientConnection& connection, uint64_t* result);
