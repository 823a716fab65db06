// The handlers of the code-signing commands (18 to 20): the installer's
// information about what each identifier is entitled to.
#pragma once

#include "core/QRVCommandTable.h"

// 18: stores "CodeSigningInfo" (a dictionary; absent removes the entry) for
// "Identifier" with "OptionsDictionary" (optional). The mapping's code is
// the result.
void QRVHandleProcessCodeSigningInfo(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                     QRVClientConnection& connection, uint64_t* result);
// 19: the stored information of "Identifier" ("ReplyInfoDictionary"); 67
// when there is none to hand out.
void QRVHandleCodeSigningInfoForIdentifier(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                           QRVClientConnection& connection, uint64_t* result);
// 20: invalidates the information of applications whose bundle is gone.
void QRVHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer(const QRVPlist& request,
                                                                     const std::shared_ptr<QRVReply>& reply,
                                                                     QRVClientConnection& connection, uint64_t* result);
