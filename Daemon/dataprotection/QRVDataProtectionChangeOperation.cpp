#include "dataprotection/QRVDataProtectionChangeOperation.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <exception>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"
#include "core/QRVCrashPoints.h"
#include "core/QRVLocks.h"
#include "fs/QRVDictionaryAdditions.h"
#include "fs/QRVPathComponents.h"
#include "model/QRVUserIdentity.h"
#include "operations/QRVClientConnection.h"

namespace {

using Op = QRVDataProtectionChangeOperation;

// The class a regular file gets when the target is 0 ("none asked for"):
// files must never be left without protection by this operation.
constexpr uint32_t kDefaultFileClass = 3;
// The class whose items are never changed: files open for writing while
// locked depend on it.
constexpr uint32_t kUntouchableClass = 2;

std::string describe(const QRVPlist* value) { return value ? value->description() : std::string("(null)"); }

bool isNumber(const QRVPlist* value) { return value && value->type() == QRVPlist::Type::UInteger; }

// An identifier read back names the update file and the container: it must
// be one file name, never a path that could lead elsewhere.
bool isSingleComponent(const std::string& identifier) {
  return !identifier.empty() && identifier != "." && identifier != ".." && identifier.find('/') == std::string::npos &&
         identifier.find('\0') == std::string::npos;
}

// Whether `path` lies strictly inside the directory `tree`, by its text.
bool textuallyInside(const std::string& path, std::string tree) {
  tree = QRVPathWithoutTrailingSlashes(std::move(tree));
  return path.size() > tree.size() + 1 && path.compare(0, tree.size(), tree) == 0 && path[tree.size()] == '/' &&
         !QRVContainsDotDotPathComponents(path);
}

QRVError invalid(const std::string& message) {
  return QRVError::make(QRVError::kDomain, QRVResultCode::kInvalidFileContent,
                        "_readAndValidateDataProtectionUpdateAtURL", 0, QRVLogLevel::kError, message);
}

}  // namespace

// ---- Construction ----

QRVDataProtectionChangeOperation::QRVDataProtectionChangeOperation(QRVMetadataRef metadata, int32_t newClass,
                                                                   bool retryingIfLocked, uint32_t changeType,
                                                                   const QRVUUID& internalChangeID,
                                                                   std::shared_ptr<QRVSerialQueue> queue,
                                                                   std::shared_ptr<QRVServices> services)
    : metadata_(std::move(metadata)),
      newClass_(newClass),
      retryIfLocked_(retryingIfLocked),
      changeType_(changeType),
      internalChangeID_(internalChangeID),
      queue_(std::move(queue)),
      services_(std::move(services)) {}

std::shared_ptr<Op> QRVDataProtectionChangeOperation::initWithContainerMetadata(QRVMetadataRef metadata,
                                                                                int32_t newClass, bool retryingIfLocked,
                                                                                uint32_t changeType,
                                                                                std::shared_ptr<QRVSerialQueue> queue,
                                                                                std::shared_ptr<QRVServices> services) {
  return initWithContainerMetadata(std::move(metadata), newClass, retryingIfLocked, changeType, QRVUUID::random(),
                                   std::move(queue), std::move(services));
}

std::shared_ptr<Op> QRVDataProtectionChangeOperation::initWithContainerMetadata(
    QRVMetadataRef metadata, int32_t newClass, bool retryingIfLocked, uint32_t changeType,
    const QRVUUID& internalChangeID, std::shared_ptr<QRVSerialQueue> queue, std::shared_ptr<QRVServices> services) {
  return std::make_shared<Op>(std::move(metadata), newClass, retryingIfLocked, changeType, internalChangeID,
                              std::move(queue), std::move(services));
}

std::string QRVDataProtectionChangeOperation::_url() const {
  return metadata_ ? urlForProtectionOperationWithContainerIdentity(*metadata_->containerIdentity(), *services_)
                   : std::string();
}

std::string QRVDataProtectionChangeOperation::_userDescription() const {
  return metadata_ && metadata_->userIdentity() ? metadata_->userIdentity()->description() : std::string("(null)");
}

// ---- The update file ----

std::string QRVDataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
    const QRVContainerIdentity& containerIdentity, QRVServices& services) {
  const QRVUserIdentityRef& user = containerIdentity.userIdentity();
  const std::string name = fmt::format("{}-{}-{}.plist", containerIdentity.identifier(),
                                       containerIdentity.containerClass(), user ? user->identifier() : "(null)");
  return QRVPathByAppendingComponent(services.globalConfiguration->pendingUpdatesDirectory(), name);
}

bool QRVDataProtectionChangeOperation::writeToDiskWithError(QRVError* error) {
  bool ok = false;
  queue_->sync([&] { ok = _onQueue_writeToDiskWithError(error); });
  if (ok) QRVCrashPoint(*services_, "dataprotection.update-written");
  return ok;
}

bool QRVDataProtectionChangeOperation::_onQueue_writeToDiskWithError(QRVError* error) {
  if (!metadata_ || changeType_ == 0)
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "Invalid Update Info: metadata: {}, changeType: {}",
                                    metadata_ ? metadata_->description() : std::string("(null)"), changeType_));
  QRVPlist update = QRVPlist::dictionary()
                        .set(kIdentifierKey, QRVPlist::string(metadata_->identifier()))
                        .set(kContainerClassKey, QRVPlist::uinteger(metadata_->containerClass()))
                        .set(kProtectionClassKey, QRVPlist::uinteger(static_cast<uint32_t>(newClass_)))
                        .set(kChangeTypeKey, QRVPlist::uinteger(changeType_))
                        .set(kRetryIfLockedKey, QRVPlist::boolean(retryIfLocked_))
                        .set(kInternalIDKey, QRVPlist::string(internalChangeID_.string()));
  if (QRVUserIdentity::isUserIdentityRequiredForContainerClass(metadata_->containerClass()) &&
      metadata_->userIdentity())
    update.set(kUserIdentityKey, metadata_->userIdentity()->plist());

  const std::string url = _url();
  QRVFileManager& fm = *services_->fileManager;
  QRVError underlying;
  if (!fm.removeFileAtURL(url, &underlying))
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileNotMovedOrRemoved, underlying,
                                               "Failed to remove pending data protection file at {}", url));
  // The pending-updates directory may not exist yet on a fresh system.
  fm.createDirectoryAtURL(QRVPathComponents::parentDirectory(url), /*withIntermediateDirectories=*/true, 0755, nullptr);
  // No class of its own: it must be readable while the device is locked.
  if (!QRV_writeToURL(fm, update, url, &underlying))
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileNotWritten, underlying,
                                               "Failed to write data protection update dictionary to URL {}", url));
  return true;
}

bool QRVDataProtectionChangeOperation::_stillMostCurrentUpdate() {
  bool current = false;
  queue_->sync([&] { current = _onQueue_stillMostCurrentUpdate(); });
  return current;
}

bool QRVDataProtectionChangeOperation::_onQueue_stillMostCurrentUpdate() {
  const std::string url = _url();
  QRVError error;
  std::optional<QRVDataProtectionUpdate> update = _readAndValidateDataProtectionUpdateAtURL(url, *services_, &error);
  if (!update) {
    QRVLogError("Failed to read data protection update from {}", url);
    return false;
  }
  return update->internalChangeID == internalChangeID_;
}

bool QRVDataProtectionChangeOperation::_deleteUpdateFileWithError(QRVError* error) {
  bool ok = false;
  queue_->sync([&] { ok = _onQueue_deleteUpdateFileWithError(error); });
  return ok;
}

bool QRVDataProtectionChangeOperation::_onQueue_deleteUpdateFileWithError(QRVError* error) {
  if (!metadata_)
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput,
                                    "Invalid Update Info: metadata: (null), changeType: {}", changeType_));
  if (!_onQueue_stillMostCurrentUpdate()) {
    QRVLogNotice("Nothing to delete because there is a newer update for user: {}, id: {}, containerClass: {}",
                 _userDescription(), metadata_->identifier(), metadata_->containerClass());
    return true;
  }
  return deleteUpdateFileWithContainerIdentity(*metadata_->containerIdentity(), *services_, error);
}

bool QRVDataProtectionChangeOperation::deleteUpdateFileWithContainerIdentity(
    const QRVContainerIdentity& containerIdentity, QRVServices& services, QRVError* error) {
  const std::string url = urlForProtectionOperationWithContainerIdentity(containerIdentity, services);
  QRVError underlying;
  if (!services.fileManager->removeFileAtURL(url, &underlying)) {
    QRVLogError("Failed to remove data protection file at {} : {}", url, underlying.description());
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileNotMovedOrRemoved, underlying,
                                               "Failed to remove pending data protection file at {}", url));
  }
  return true;
}

std::optional<QRVDataProtectionUpdate> QRVDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(
    const std::string& url, QRVServices& services, QRVError* error) {
  if (url.empty()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "URL cannot be nil"));
    return std::nullopt;
  }
  QRVError underlying;
  // Read without trusting the file: a link, a fifo or a huge file planted in
  // its place is refused.
  std::vector<uint8_t> bytes;
  std::optional<QRVPlist> file;
  if (services.fileManager->readRegularFileAtURL(url, 1 << 16, &bytes, &underlying)) {
    file = QRVPlist::fromBytes(bytes.data(), bytes.size());
    if (!file || !file->isDictionary()) file.reset();
  }
  if (!file) {
    QRVFail(error, underlying.code()
                       ? QRV_ERROR_UNDERLYING(QRVResultCode::kFileUnreadable, underlying,
                                              "Failed to read update info at URL {}", url)
                       : QRV_ERROR(QRVResultCode::kFileUnreadable, "Failed to read update info at URL {}", url));
    return std::nullopt;
  }
  auto fail = [&](std::string message) -> std::optional<QRVDataProtectionUpdate> {
    QRVFail(error, invalid(std::move(message)));
    return std::nullopt;
  };

  QRVDataProtectionUpdate update;
  const QRVPlist* identifier = file->get(kIdentifierKey);
  if (!identifier || !identifier->isString() || !isSingleComponent(identifier->stringValue()))
    return fail(fmt::format("Invalid update info Identifier: {} at {}", describe(identifier), url));
  update.identifier = identifier->stringValue();

  const QRVPlist* containerClass = file->get(kContainerClassKey);
  const uint64_t classValue = isNumber(containerClass) ? containerClass->uint64Value() : 0;
  if (!QRVContainerClassIsValid(classValue))
    return fail(fmt::format("Invalid update info container class: {} at {}", static_cast<int64_t>(classValue), url));
  update.containerClass = classValue;

  if (QRVUserIdentity::isUserIdentityRequiredForContainerClass(update.containerClass)) {
    QRVUserIdentityCache& cache = *services.userIdentityCache;
    if (const QRVPlist* identity = file->get(kUserIdentityKey)) {
      QRVError identityError;
      update.userIdentity =
          identity->isDictionary() ? QRVUserIdentity::userIdentityWithPlist(*identity, cache, &identityError) : nullptr;
      if (!update.userIdentity)
        return fail(fmt::format("Invalid update info user identity: {} at {}: {}", identity->description(), url,
                                update.containerClass));
    } else if (const QRVPlist* uid = file->get(kUserIdKey)) {
      if (isNumber(uid) && uid->uint64Value() <= UINT32_MAX) {
        const auto id = static_cast<uid_t>(uid->uint64Value());
        update.userIdentity = cache.userIdentityForPersonalPersonaWithUID(id, id);
      }
      if (!update.userIdentity) return fail(fmt::format("Invalid update info user id: {} at {}", describe(uid), url));
    } else {
      return fail(fmt::format("Invalid update info user identity: {} at {}: {}", describe(nullptr), url,
                              update.containerClass));
    }
  }

  const QRVPlist* protectionClass = file->get(kProtectionClassKey);
  if (!isNumber(protectionClass) || protectionClass->uint64Value() > UINT32_MAX)
    return fail(fmt::format("Invalid update info protection class: {} at {}", describe(protectionClass), url));
  update.protectionClass = static_cast<int32_t>(static_cast<uint32_t>(protectionClass->uint64Value()));

  // Only the three known bits, and at least one of them: anything else is not
  // a file this daemon wrote.
  const QRVPlist* changeType = file->get(kChangeTypeKey);
  if (!isNumber(changeType) || changeType->uint64Value() == 0 || changeType->uint64Value() > 7)
    return fail(fmt::format("Invalid update info change type: {} at {}", describe(changeType), url));
  update.changeType = static_cast<uint32_t>(changeType->uint64Value());

  const QRVPlist* retry = file->get(kRetryIfLockedKey);
  if (!retry || (retry->type() != QRVPlist::Type::Boolean && !isNumber(retry)))
    return fail(fmt::format("Invalid update info retry: {} at {}", describe(retry), url));
  update.retryIfLocked = retry->type() == QRVPlist::Type::Boolean ? retry->boolValue() : retry->uint64Value() != 0;

  const QRVPlist* internalID = file->get(kInternalIDKey);
  if (!internalID || !internalID->isString())
    return fail(fmt::format("Invalid update info UUID String: {} at {}", describe(internalID), url));
  std::optional<QRVUUID> uuid = QRVUUID::fromString(internalID->stringValue());
  if (!uuid) return fail(fmt::format("Invalid update info UUID: {} at {}", internalID->stringValue(), url));
  update.internalChangeID = *uuid;
  return update;
}

std::shared_ptr<Op> QRVDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
    const std::string& url, std::shared_ptr<QRVSerialQueue> queue, std::shared_ptr<QRVServices> services,
    QRVError* error) {
  // Only the reading happens on the file queue: the look-up below takes the
  // identifier locks, and a pass holding one of those waits for the file
  // queue (to check that it is still current).
  std::optional<QRVDataProtectionUpdate> update;
  queue->sync([&] { update = _readAndValidateDataProtectionUpdateAtURL(url, *services, error); });
  if (!update) return nullptr;
  QRVUserIdentityRef user = update->userIdentity;
  if (!user) user = services->userIdentityCache->defaultUserIdentity();
  if (!user) {
    QRVFail(error, invalid("Could not create user identity."));
    return nullptr;
  }
  QRVError underlying;
  QRVContainerIdentityRef identity = QRVContainerIdentity::containerIdentityWithUserIdentity(
      user, update->identifier, update->containerClass, &underlying);
  if (!identity) {
    QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kInvalidFileContent, underlying,
                                        "Invalid update info Identifier: {} at {}", update->identifier, url));
    return nullptr;
  }
  // The file must be the one this daemon would have written for the
  // container it names; one planted under another name is not ours to act on.
  if (urlForProtectionOperationWithContainerIdentity(*identity, *services) != url) {
    QRVFail(error, invalid(fmt::format("Invalid update info Identifier: {} at {}", update->identifier, url)));
    return nullptr;
  }
  std::shared_ptr<QRVClientConnection> connection = QRVClientConnection::makeSharedClientConnection(services);
  QRVMetadataRef metadata = connection->createOrLookupContainerWithContainerIdentity(
      identity, /*createIfNecessary=*/false, /*transient=*/false, /*useLocking=*/true, &underlying);
  std::optional<std::string> tree = services->globalConfiguration->containerDirectoryURLForUserIdentity(
      user, update->containerClass, /*transient=*/false);
  if (metadata && (!tree || !textuallyInside(metadata->url(), *tree))) {
    underlying = QRV_ERROR(QRVResultCode::kUnexpectedPath, "{} lies outside {}", metadata->url(), tree.value_or(""));
    metadata = nullptr;
  }
  if (!metadata) {
    QRVFail(error,
            QRV_ERROR_UNDERLYING(QRVResultCode::kNoSuchContainer, underlying,
                                 "Failed to lookup container metadata from file userId: {}, identifier: {}, "
                                 "Class: {} : {}",
                                 user->posixUID(), update->identifier, update->containerClass, underlying.code()));
    return nullptr;
  }
  return initWithContainerMetadata(std::move(metadata), update->protectionClass, update->retryIfLocked,
                                   update->changeType, update->internalChangeID, std::move(queue), std::move(services));
}

// ---- Running ----

void QRVDataProtectionChangeOperation::performChangeOperation() {
  bool needToRetry = false;
  QRVError error;
  bool ok = _runChangeOperationNeedToRetry(&needToRetry, &error);
  if (!ok) {
    QRVLogNotice(
        "Operation to update protection classes for user: {}, id: {}, containerClass: {} to class {} failed with "
        "error {}",
        _userDescription(), metadata_ ? metadata_->identifier() : "(null)", metadata_ ? metadata_->containerClass() : 0,
        newClass_, error.description());
    needToRetry = false;
  }
  if (needToRetry && retryIfLocked_) {
    QRVLogNotice("Retrying container protection update to {} on next unlock for user: {}, id: {}, containerClass: {}",
                 newClass_, _userDescription(), metadata_->identifier(), metadata_->containerClass());
    std::shared_ptr<Op> self = shared_from_this();
    services_->asyncWithKeepAlive(services_->lockStateQueue, [self] {
      if (!self->retried_.exchange(true) && self->retryStartBlock_) self->retryStartBlock_();
      self->performChangeOperation();
    });
    return;
  }
  if (needToRetry) {
    ok = false;
    error = QRV_ERROR(QRVResultCode::kDeviceLocked,
                      "Tried to update user: {}, id: {}, containerClass: {} to protection class {}, but was locked "
                      "and didn't retry",
                      _userDescription(), metadata_->identifier(), metadata_->containerClass(), newClass_);
  }
  QRVCrashPoint(*services_, "dataprotection.before-delete");
  QRVError deleteError;
  if (!_deleteUpdateFileWithError(&deleteError))
    QRVLogError("Failed to delete update file for user: {}, id: {}, containerClass: {}, protection class {}",
                _userDescription(), metadata_ ? metadata_->identifier() : "(null)",
                metadata_ ? metadata_->containerClass() : 0, newClass_);
  if (completionBlock_) completionBlock_(needToRetry, ok ? nullptr : &error);
}

bool QRVDataProtectionChangeOperation::_runChangeOperationNeedToRetry(bool* needToRetry, QRVError* error) {
  *needToRetry = false;
  try {
    if (!metadata_)
      return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput,
                                      "Invalid Update Info: metadata: (null), "
                                      "changeType: {}",
                                      changeType_));
    QRVIdentifierWriteLock lock(metadata_->uuid().string());
    return _lockedPass(needToRetry, error);
  } catch (const std::exception& e) {
    return QRVFail(error,
                   QRV_ERROR(QRVResultCode::kException, "Exception during data protection change: {}", e.what()));
  } catch (...) {
    return QRVFail(error, QRV_ERROR(QRVResultCode::kException, "Exception during data protection change"));
  }
}

bool QRVDataProtectionChangeOperation::_lockedPass(bool* needToRetry, QRVError* error) {
  const QRVMetadata& m = *metadata_;
  // Plain identity: a container replaced under the same name is found, and
  // then refused below by its path.
  QRVError underlying;
  QRVContainerIdentityRef identity = QRVContainerIdentity::containerIdentityWithUserIdentity(
      m.userIdentity(), m.identifier(), m.containerClass(), &underlying);
  QRVMetadataRef found;
  if (identity) {
    std::shared_ptr<QRVClientConnection> connection = QRVClientConnection::makeSharedClientConnection(services_);
    found = connection->createOrLookupContainerWithContainerIdentity(identity, /*createIfNecessary=*/false,
                                                                     /*transient=*/false, /*useLocking=*/false,
                                                                     &underlying);
  }
  if (!found)
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kNoSuchContainer, underlying,
                                               "Failed to lookup container to set data protection for user "
                                               "identity: {}, identifier: {}, Class: {}",
                                               _userDescription(), m.identifier(), m.containerClass()));
  if (found->url() != m.url())
    return QRVFail(error, QRV_ERROR(QRVResultCode::kUnexpectedPath,
                                    "Cancelling data protection operation because container path changed on disk. "
                                    "This indicates the app may have been updated and changed its protection "
                                    "level."));
  if (!_stillMostCurrentUpdate())
    return QRVFail(error, QRV_ERROR(QRVResultCode::kSuperseded,
                                    "Cancelling data protection operation because another more current operation "
                                    "on this container has taken precedence"));

  QRVFileManager& fm = *services_->fileManager;
  const std::vector<std::string>& excluded = QRVGlobalConfiguration::excludedFromAppUserData();
  std::vector<std::string> items;
  for (const std::string& name : QRVGlobalConfiguration::appUserDataItemNames()) {
    if (std::find(excluded.begin(), excluded.end(), name) != excluded.end()) continue;
    if (m.url().empty()) {
      QRVLogError("itemURL is nil for item: {}", name);
      continue;
    }
    std::string itemURL = QRVPathByAppendingComponent(m.url(), name);
    if (fm.itemExistsAtURL(itemURL)) items.push_back(std::move(itemURL));
  }
  bool first = true;
  for (const std::string& itemURL : items) {
    QRVError walkError;
    if (!_changeItemAtURL(itemURL, &walkError)) {
      // The device locked under the walk: what is done stays done, the rest
      // waits for the next pass.
      if (walkError.isPOSIX() && walkError.code() == EPERM) {
        *needToRetry = true;
        return true;
      }
      return QRVFail(error, std::move(walkError));
    }
    if (first) QRVCrashPoint(*services_, "dataprotection.first-item-changed");
    first = false;
  }
  return true;
}

bool QRVDataProtectionChangeOperation::_changeItemAtURL(const std::string& itemURL, QRVError* error) {
  using Kind = QRVDirectoryEntry::Kind;
  QRVFileManager& fm = *services_->fileManager;
  const auto target = static_cast<uint32_t>(newClass_);
  const uint32_t fileTarget = target == 0 ? kDefaultFileClass : target;
  const bool neverRaise = (changeType_ & kNeverRaiseFileClass) != 0;

  // Built once for the whole walk: a container may hold a great many items.
  std::string_view current;  // the directory the predicate is asked about
  const std::function<bool(uint32_t)> directoryPredicate = [&](uint32_t itemClass) {
    if (itemClass == kUntouchableClass) return false;
    QRVLogDebug("Setting protection class of {} to {}", current, newClass_);
    return true;
  };
  const std::function<bool(uint32_t)> filePredicate = [&](uint32_t itemClass) {
    if (itemClass == kUntouchableClass || itemClass == fileTarget) return false;
    return !(neverRaise && fileTarget > itemClass);
  };

  QRVError walkError;
  bool ok = fm.traverseItemAtURLWithoutFollowingLinks(
      itemURL, &walkError, [&](const QRVDirectoryEntry& entry, QRVError* stop) {
        QRVError setError;
        bool set = true;
        switch (entry.kind) {
          case Kind::kDirectoryPostOrder:
            current = entry.path;
            if (changeType_ & kChangeDirectories)
              set = fm.setDataProtectionClassOfOpenItem(entry.fd, entry.path, target, directoryPredicate, &setError);
            break;
          case Kind::kRegularFile:
            if (changeType_ & kChangeFiles)
              set = fm.setDataProtectionClassOfOpenItem(entry.fd, entry.path, fileTarget, filePredicate, &setError);
            break;
          case Kind::kDirectory:
          case Kind::kSymbolicLink:
          case Kind::kOther:
            break;
          case Kind::kDirectoryCycle:
          case Kind::kUnreadableDirectory:
            QRVLogError("FTS returned error for {} : {}", entry.path, strerror(entry.errnum));
            break;
        }
        if (set) return true;
        if (setError.isPOSIX() && setError.code() == EBADF) {
          QRVLogError("Ignoring failure to set protection class to {} on {} (mode 0{:o}): {}", newClass_, entry.path,
                      entry.stat->st_mode, setError.description());
          return true;
        }
        *stop = std::move(setError);
        return false;
      });
  if (ok) return true;
  if (!walkError.code()) walkError = QRV_POSIX_ERROR(EIO, "fts_open failed for {} : {}", itemURL, strerror(EIO));
  return QRVFail(error, std::move(walkError));
}
