#include "core/QRVDataProtectionHandlers.h"

#include <cstdint>

#include "base/QRVResultCode.h"
#include "core/QRVRequestUnpacking.h"
#include "core/QRVServices.h"
#include "dataprotection/QRVDataProtectionManager.h"

void QRVHandleSetDataProtection(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                QRVClientConnection& connection, uint64_t* result) {
  QRVError error;
  QRVContainerIdentityRef identity = QRVRequestUnpacking::containerIdentity(request, connection, &error);
  if (!identity) {
    *result = error.resultCode();
    return;
  }
  // Classes are small numbers; a value that does not fit the class type
  // would otherwise be cut to one the caller did not ask for.
  const uint64_t requested = request.uint64ForKey("DataProtectionClass");
  if (requested > INT32_MAX) {
    QRVError refused =
        QRV_ERROR(QRVResultCode::kInvalidInput, "Data protection class {} is not allowed", requested);
    *result = refused.resultCode();
    return;
  }
  connection.services().dataProtectionManager->setDataProtectionOnDataContainerForContainerIdentity(
      identity, static_cast<int32_t>(requested), request.boolForKey("IsThirdParty"),
      request.boolForKey("RetryIfLocked"), [reply](const QRVError* failure) {
        reply->dictionary().set("ReplyError",
                                QRVPlist::uinteger(failure ? failure->resultCode() : QRVResultCode::kSuccess));
        reply->send();
      });
}
