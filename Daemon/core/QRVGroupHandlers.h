// The handlers of the group and system container commands (13 to 17).
//
// Commands 13, 14 and 16 name an owner and a group class: "Identifier" (the
// caller's own bundle identifier when absent) and "ContainerClass", which
// must be 7 (application groups) or 13 (system groups); anything else is 11.
#pragma once

#include "core/QRVCommandTable.h"

// 13: the owner's group containers, created as needed, with their paths
// ("ReplyGroupContainerDict") and sandbox tokens ("SandboxTokenDict").
void QRVHandleCreateOrLookupGroupContainers(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                            QRVClientConnection& connection, uint64_t* result);
// 14: the group identifiers the owner claims ("ReplyGroupIdentifiersArray").
void QRVHandleGroupContainerIdentifiersForOwner(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                                QRVClientConnection& connection, uint64_t* result);
// 15: a system container (class 12); well-known ones are created as needed,
// any other is only looked up ("ReplyPath").
void QRVHandleLookupSystemContainer(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                    QRVClientConnection& connection, uint64_t* result);
// 16: as 13, paths only.
void QRVHandleGroupContainersForOwner(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                      QRVClientConnection& connection, uint64_t* result);
// 17: the path of a system group container the caller's code signing lists
// ("GroupIdentifier"; "ReplyPath").
void QRVHandleSystemGroupContainerPath(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                       QRVClientConnection& connection, uint64_t* result);
