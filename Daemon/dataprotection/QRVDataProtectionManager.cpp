#include "dataprotection/QRVDataProtectionManager.h"

#include <cerrno>
#include <optional>
#include <utility>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"
#include "core/QRVServices.h"
#include "operations/QRVApplicationTerminationAssertion.h"
#include "operations/QRVClientConnection.h"

namespace {

using Op = QRVDataProtectionChangeOperation;

// The only class a client may never ask for: files open for writing while
// locked depend on it, and a whole container in it would never be protected.
constexpr int32_t kForbiddenClass = 2;
// The highest class an application that is not the system's own may ask
// for.
constexpr int32_t kHighestThirdPartyClass = 3;

// The class named by an entitlement value; nothing for a name this daemon
// does not know.
std::optional<uint32_t> classForProtectionName(const std::string& name) {
  static const std::pair<const char*, uint32_t> kNames[] = {
      {"KLFileProtectionComplete", 1},
      {"KLFileProtectionCompleteUnlessOpen", 2},
      {"KLFileProtectionWriteOnly", 2},
      {"KLFileProtectionCompleteUntilFirstUserAuthentication", 3},
      {"KLFileProtectionCompleteUntilUserAuthentication", 3},
      {"KLFileProtectionNone", 4},
  };
  for (const auto& [known, protectionClass] : kNames)
    if (name == known) return protectionClass;
  return std::nullopt;
}

// Holds the application stopped while a retried change works through its
// files. Taken on the lock-state queue when the retry starts and released by
// the completion, which then runs on the same queue: never touched by two
// threads at once.
struct HeldTermination {
  std::unique_ptr<QRVApplicationTerminationAssertion> assertion;
};

}  // namespace

QRVDataProtectionManager::QRVDataProtectionManager(std::weak_ptr<QRVServices> services)
    : services_(std::move(services)),
      fileQueue_(QRVSerialQueue::create("com.kelva.Quorva.ProtectionOperationFileQueue")) {}

std::shared_ptr<QRVServices> QRVDataProtectionManager::_services() const { return services_.lock(); }

uint32_t QRVDataProtectionManager::intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
    const std::string& identifier) {
  std::shared_ptr<QRVServices> services = _services();
  if (!services || !services->codeSigningMapping) return 0;
  std::optional<QRVPlist> entitlements = services->codeSigningMapping->entitlementsForIdentifier(identifier);
  if (!entitlements || !entitlements->isDictionary()) return 0;
  for (const char* key :
       {kDefaultDataProtectionEntitlement, kDataProtectionClassEntitlement, kLegacyDataProtectionClassEntitlement}) {
    const QRVPlist* value = entitlements->get(key);
    if (!value || !value->isString()) continue;
    if (std::optional<uint32_t> protectionClass = classForProtectionName(value->stringValue())) return *protectionClass;
    QRVLogError("Unknown value for DataProtectionClass entitlement: {}; defaulting to class {}", value->stringValue(),
                0);
    return 0;
  }
  return 0;
}

void QRVDataProtectionManager::setDataProtectionOnDataContainerForContainerIdentity(
    const QRVContainerIdentityRef& containerIdentity, int32_t dataProtectionClass, bool isSecondOrThirdPartyApp,
    bool retryIfLocked, Completion completion) {
  auto finish = [&](const QRVError* error) {
    if (completion) completion(error);
  };
  auto fail = [&](QRVError error) { finish(&error); };
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return fail(QRV_ERROR(QRVResultCode::kInvalidInput, "The daemon is shutting down"));

  // Only data containers (the per-user classes) have a class of their own.
  if (!containerIdentity || !QRVContainerClassIsPerUser(containerIdentity->containerClass()))
    return fail(QRV_ERROR(QRVResultCode::kInvalidObject, "Can't act on an invalid object: identity: {}",
                          containerIdentity ? containerIdentity->description() : std::string("(null)")));

  QRVError lookupError;
  QRVMetadataRef metadata = QRVClientConnection::makeSharedClientConnection(services)
                                ->createOrLookupContainerWithContainerIdentity(containerIdentity,
                                                                               /*createIfNecessary=*/false,
                                                                               /*transient=*/false,
                                                                               /*useLocking=*/true, &lookupError);
  if (!metadata)
    return fail(QRV_ERROR_UNDERLYING(QRVResultCode::kNoSuchContainer, lookupError, "No Container with identity: {}",
                                     containerIdentity->description()));

  const auto current = static_cast<int32_t>(QRVContentProtectionClassInInfo(metadata->info()).value_or(0));
  if (dataProtectionClass == current) {
    // Nothing to change; an older change still waiting for an unlock would
    // now undo what the caller asks for, so it goes.
    fileQueue_->sync([&] {
      QRVError error;
      if (!Op::deleteUpdateFileWithContainerIdentity(*metadata->containerIdentity(), *services, &error))
        QRVLogError("Failed to delete existing data protection update file: {}", error.description());
    });
    return finish(nullptr);
  }
  if (dataProtectionClass == kForbiddenClass)
    return fail(
        QRV_ERROR(QRVResultCode::kInvalidInput, "Data protection class {} is not allowed", dataProtectionClass));
  if (isSecondOrThirdPartyApp && dataProtectionClass > kHighestThirdPartyClass)
    return fail(QRV_ERROR(QRVResultCode::kInvalidInput, "Data protection class {} is invalid for 2nd and 3rd party apps",
                          dataProtectionClass));

  // Lowering the class (or going from none to a strong one) must reach the
  // files already there; raising it need only change the directories, whose
  // class new files inherit, and never weakens a file.
  const uint32_t changeType =
      current > dataProtectionClass || (current == 0 && dataProtectionClass <= kForbiddenClass)
          ? Op::kChangeDirectories | Op::kChangeFiles | Op::kNeverRaiseFileClass
          : Op::kChangeDirectories;
  std::shared_ptr<Op> operation =
      Op::initWithContainerMetadata(metadata, dataProtectionClass, retryIfLocked, changeType, fileQueue_, services);
  QRVError writeError;
  // Without the file a crash loses the change, but the change itself can
  // still be made now.
  if (!operation->writeToDiskWithError(&writeError))
    QRVLogError("Failed to write data protection update file to disk: {}", writeError.description());
  _startDataProtectionChangeOperation(operation, std::move(completion));
}

void QRVDataProtectionManager::_startDataProtectionChangeOperation(const std::shared_ptr<Op>& operation,
                                                                   Completion completion) {
  std::shared_ptr<QRVServices> services = _services();
  auto held = std::make_shared<HeldTermination>();
  const QRVMetadataRef metadata = operation->dataContainerMetadata();
  const std::string identifier = metadata->identifier();

  std::shared_ptr<QRVApplicationTermination> termination =
      services ? services->platform.applicationTermination : nullptr;
  operation->setRetryStartBlock([held, termination, identifier] {
    held->assertion = std::make_unique<QRVApplicationTerminationAssertion>(
        termination, identifier, QRVApplicationTerminationAssertion::kReasonDataProtection);
  });

  // The completion holds the operation weakly: the operation owns it.
  std::weak_ptr<Op> weakOperation = operation;
  std::weak_ptr<QRVServices> weakServices = services_;
  const int32_t newClass = operation->newDataProtectionClass();
  operation->setCompletionBlock([held, weakOperation, weakServices, metadata, newClass,
                                 completion = std::move(completion)](bool needToRetry, const QRVError* error) {
    std::shared_ptr<Op> ended = weakOperation.lock();
    if (error)
      QRVLogError("Failed to set data protection on container with identifier {} at {} to {}: {}",
                  metadata->identifier(), metadata->url(), newClass, error->description());
    if (needToRetry && ended && ended->retried())
      QRVLogError("Unexpectedly got completion block called with wasLocked");
    if (held->assertion) held->assertion->invalidate();
    held->assertion.reset();

    std::shared_ptr<QRVServices> live = weakServices.lock();
    if (!error && !needToRetry && live) {
      QRVError infoError;
      std::shared_ptr<QRVClientConnection> connection =
          QRVClientConnection::makePrivilegedClientConnection(metadata->userIdentity(), live);
      if (!connection->setInfoValue(QRVPlist::uinteger(static_cast<uint32_t>(newClass)),
                                    QRVPlist::string(kQRVContentProtectionClassKey), metadata->containerIdentity(),
                                    /*useLocking=*/true, &infoError))
        QRVLogError("Failed to set protection class info for {} at {} to {} : {}", metadata->identifier(),
                    metadata->url(), newClass, infoError.code());
    }
    if (completion) completion(error);
  });
  operation->performChangeOperation();
}

bool QRVDataProtectionManager::restartPendingDataProtectionOperationsWithError(QRVError* error) {
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return true;
  const std::string directory = services->globalConfiguration->pendingUpdatesDirectory();
  QRVError listError;
  std::optional<std::vector<std::string>> files =
      services->fileManager->urlsForItemsInDirectoryAtURL(directory, &listError);
  if (!files) {
    if (listError.isPOSIX() && listError.code() == ENOENT) return true;
    QRVLogError("Failed to get items at pendingUpdates URL {} : {}", directory, listError.description());
    return QRVFail(error, std::move(listError));
  }
  for (const std::string& url : *files) {
    QRVLogNotice("Found pending data protection operation at {}", url);
    QRVError readError;
    std::shared_ptr<Op> operation = Op::dataProtectionChangeOperationAtURL(url, fileQueue_, services, &readError);
    if (!operation) {
      // Left where it is: a file that cannot be read now may be readable by
      // a later build, and it is evidence of what went wrong.
      QRVLogError("Failed to read data protection change operation at {} : {}", url, readError.description());
      continue;
    }
    const QRVMetadataRef& metadata = operation->dataContainerMetadata();
    QRVLogNotice("Starting pending data protection update to protection class {} for user: {}, ID: {}, "
                 "containerClass: {}",
                 operation->newDataProtectionClass(),
                 metadata->userIdentity() ? metadata->userIdentity()->description() : std::string("(null)"),
                 metadata->identifier(), metadata->containerClass());
    _startDataProtectionChangeOperation(operation, nullptr);
  }
  return true;
}
