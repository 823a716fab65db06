#include "core/QRVCodeSigningHandlers.h"

#include "base/QRVLog.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "operations/QRVClientConnection.h"

namespace {

// The mapping, or null with 40 when the daemon runs without one.
QRVCodeSigningMapping* mapping(QRVClientConnection& connection, uint64_t* result) {
  QRVCodeSigningMapping* m = connection.services().codeSigningMapping.get();
  if (!m) {
    QRVError error = QRV_ERROR(QRVResultCode::kException, "No code-signing mapping");
    *result = error.resultCode();
  }
  return m;
}

// "Identifier": absent is 18, anything but a non-empty string 11.
std::optional<std::string> identifierArgument(const QRVPlist& request, uint64_t* result) {
  const QRVPlist* identifier = request.get("Identifier");
  QRVError error;
  if (!identifier)
    error = QRV_ERROR(QRVResultCode::kMissingIdentifier, "Missing identifier");
  else if (!identifier->isString() || identifier->stringValue().empty())
    error =
        QRV_ERROR(QRVResultCode::kInvalidObject, "Can't act on an invalid object: ID: {}", identifier->description());
  else
    return identifier->stringValue();
  *result = error.resultCode();
  return std::nullopt;
}

}  // namespace

void QRVHandleProcessCodeSigningInfo(const QRVPlist& request, const std::shared_ptr<QRVReply>&,
                                     QRVClientConnection& connection, uint64_t* result) {
  std::optional<std::string> identifier = identifierArgument(request, result);
  if (!identifier) return;
  // Both arguments are optional; when given they must be dictionaries, as
  // everything the mapping stores is read back as one.
  const QRVPlist* info = request.get("CodeSigningInfo");
  const QRVPlist* options = request.get("OptionsDictionary");
  if ((info && !info->isDictionary()) || (options && !options->isDictionary())) {
    QRVError error = QRV_ERROR(
        QRVResultCode::kInvalidInput, "Can't act on an invalid input: code signing info: {}, options: {} for {}",
        info ? info->description() : "(null)", options ? options->description() : "(null)", *identifier);
    *result = error.resultCode();
    return;
  }
  QRVCodeSigningMapping* m = mapping(connection, result);
  if (!m) return;
  uint64_t code = m->processCodeSigningInfo(info ? *info : QRVPlist(), identifier, options ? *options : QRVPlist(),
                                            connection.commandQueue());
  if (code != QRVResultCode::kSuccess) *result = code;
}

void QRVHandleCodeSigningInfoForIdentifier(const QRVPlist& request, const std::shared_ptr<QRVReply>& reply,
                                           QRVClientConnection& connection, uint64_t* result) {
  std::optional<std::string> identifier = identifierArgument(request, result);
  if (!identifier) return;
  QRVCodeSigningMapping* m = mapping(connection, result);
  if (!m) return;
  std::optional<QRVPlist> info = m->getCodeSigningInfoForIdentifier(*identifier);
  if (!info) {
    // Nothing stored, or nothing an outside requester may see (placeholders,
    // advance copies, invalidated entries): an expected answer.
    QRVError error = QRV_ERROR_QUIET(QRVResultCode::kDatabaseNotFound, "No code signing info for {}", *identifier);
    *result = error.resultCode();
    return;
  }
  reply->dictionary().set("ReplyInfoDictionary", std::move(*info));
}

void QRVHandleInvalidateCodeSigningInfoForAppsWithoutBundleContainer(const QRVPlist&, const std::shared_ptr<QRVReply>&,
                                                                     QRVClientConnection& connection,
                                                                     uint64_t* result) {
  QRVCodeSigningMapping* m = mapping(connection, result);
  if (!m) return;
  uint64_t code = m->invalidateCodeSigningInfoForAppsWithoutBundleContainer();
  if (code != QRVResultCode::kSuccess) *result = code;
}
