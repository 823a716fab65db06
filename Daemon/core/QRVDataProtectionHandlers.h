// The handler of the data-protection command (21).
#pragma once

#include "core/QRVCommandTable.h"

// 21: changes a data container's protection class: the container identity
// without UUID, "DataProtectionClass", "IsThirdParty" and "RetryIfLocked".
// The reply ("ReplyError") is sent when the change has ended, which on a
// locked device with "RetryIfLocked" is after the next unlock.
void QRVHandleSetDataProtection(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                QRVClientConnection& connection, uint64_t* result);
