#include "operations/QRVClientConnection.h"

#include <set>

#include "base/QRVLog.h"
#include "dataprotection/QRVDataProtectionManager.h"
#include "fs/QRVDictionaryAdditions.h"

QRVClientConnection::QRVClientConnection(std::shared_ptr<const QRVClientIdentity> clientIdentity, bool entitled,
                                         bool allowOtherIdLookup, bool unrestricted,
                                         std::optional<QRVPlist> lookup,
                                         std::optional<QRVPlist::Array> entitledWipeIdentifiers,
                                         std::shared_ptr<QRVCommandQueue> commandQueue,
                                         std::shared_ptr<QRVServices> services)
    : clientIdentity_(std::move(clientIdentity)),
      entitled_(entitled),
      allowOtherIdLookup_(allowOtherIdLookup),
      unrestricted_(unrestricted),
      lookup_(std::move(lookup)),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)),
      commandQueue_(std::move(commandQueue)),
      services_(std::move(services)) {}

std::shared_ptr<QRVClientConnection> QRVClientConnection::makeSharedClientConnection(
    std::shared_ptr<QRVServices> services) {
  QRVUserIdentityRef user = services->userIdentityCache->defaultUserIdentity();
  return makePrivilegedClientConnection(std::move(user), std::move(services));
}

std::shared_ptr<QRVClientConnection> QRVClientConnection::makePrivilegedClientConnection(
    QRVUserIdentityRef userIdentity, std::shared_ptr<QRVServices> services) {
  auto identity = QRVClientIdentity::privilegedClientIdentityWithUserIdentity(std::move(userIdentity));
  return std::make_shared<QRVClientConnection>(std::move(identity), /*entitled=*/true, /*allowOtherIdLookup=*/false,
                                               /*unrestricted=*/true, std::nullopt, std::nullopt,
                                               std::make_shared<QRVCommandQueue>(), std::move(services));
}

bool QRVClientConnection::completeWithError(uint64_t* result) {
  return commandQueue_->executeAllUntilExhaustedOrError(result);
}

bool QRVClientConnection::retryTestWithNumCrashes(uint64_t numCrashes, QRVError* error) {
  QRVFileManager& fm = *services_->fileManager;
  std::string directory = services_->globalConfiguration->homeDirectory() + "Library/Quorva";
  if (!fm.createDirectoryAtURL(directory, true, 0755, error)) return false;
  std::string path = directory + "/retry-test.plist";

  uint64_t crashed = 0;
  std::vector<uint8_t> bytes;
  if (fm.readFileAtURL(path, &bytes, nullptr)) {
    if (auto record = QRVPlist::fromBytes(bytes.data(), bytes.size())) crashed = record->uint64ForKey("QRVRetryTestCrashes");
  }
  if (crashed >= numCrashes) {
    QRVLogNotice("retry test done after {} crashes", crashed);
    return fm.removeFileAtURL(path, error);
  }
  QRVPlist record = QRVPlist::dictionary().set("QRVRetryTestCrashes", QRVPlist::uinteger(crashed + 1));
  if (!fm.writeFileAtomically(path, record.toBinary(), 0644, error)) return false;
  QRVLogNotice("retry test: crashing ({} of {})", crashed + 1, numCrashes);
  abort();
}
