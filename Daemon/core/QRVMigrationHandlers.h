// The handlers of the migration commands (24, 30).
#pragma once

#include "core/QRVCommandTable.h"

// 24: the data migrator's migrations (system container ACLs, bundle
// ownership, the code-signing migrations and reconciliation). No keys.
void QRVHandlePerformDataMigration(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                   QRVClientConnection& connection, uint64_t* result);
// 30: the per-user migrations (default subdirectories of every user's
// containers, protection classes of data containers without a bundle). No
// keys.
void QRVHandlePerformPerUserDataMigration(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                          QRVClientConnection& connection, uint64_t* result);
