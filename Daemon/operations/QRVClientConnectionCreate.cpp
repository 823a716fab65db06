// Creating and looking up containers: the daemon's central operation.
//
// A new container is assembled completely in a staging directory (directory,
// metadata file, ACL, default subdirectories) and only then renamed into its
// live place, so no half-built container is ever visible in the live tree.
#include <exception>

#include "base/QRVLog.h"
#include "core/QRVCrashPoints.h"
#include "core/QRVExceptionReporter.h"
#include "core/QRVLocks.h"
#include "model/QRVContainerCache.h"
#include "operations/QRVClientConnection.h"

namespace {

// The key under which the lookup entitlement lists a class's identifiers.
const char* lookupKeyForContainerClass(QRVContainerClass c) {
  static const char* const kKeys[] = {"",           "app",          "appData", "plugin",     "pluginData",
                                      "vpn",        "vpnData",      "appGroup", "framework", "relayService",
                                      "daemon",     "tempDir",      "systemData", "systemGroup"};
  return c < sizeof kKeys / sizeof kKeys[0] ? kKeys[c] : nullptr;
}

}  // namespace

const std::set<std::string>* QRVClientConnection::_lookupForContainerClass(QRVContainerClass containerClass) {
  const char* key = lookupKeyForContainerClass(containerClass);
  if (!key || !lookup_) return nullptr;
  QRVMutexLock lock(&lookupMemoMutex_);
  auto it = lookupMemo_.find(key);
  if (it == lookupMemo_.end()) {
    std::set<std::string> identifiers;
    for (const QRVPlist& v : lookup_->arrayForKey(key))
      if (v.isString()) identifiers.insert(v.stringValue());
    it = lookupMemo_.emplace(key, std::move(identifiers)).first;
  }
  return &it->second;
}

bool QRVClientConnection::isEntitledForLookupWithClass(QRVContainerClass containerClass,
                                                       const std::string& identifier) {
  const std::set<std::string>* granted = _lookupForContainerClass(containerClass);
  return granted && granted->count(identifier) > 0;
}

bool QRVClientConnection::_createTopLevelContainerDirectory(const std::string& url, QRVContainerClass containerClass,
                                                            uid_t owner, QRVError* error) {
  // Owner 0 leaves ownership alone, which keeps system containers root's.
  uid_t effectiveOwner = QRVContainerClassIsBundle(containerClass)   ? CONTAINER_INSTALLATION_UID
                         : QRVContainerClassIsSystem(containerClass) ? 0
                                                                     : owner;
  return services_->fileManager->createDirectoryAtURLWithOwner(url, true, 0755, effectiveOwner, error);
}

uint32_t QRVClientConnection::_dataProtectionClassForContainerMetadata(const QRVMetadata& metadata) {
  if (!QRVContainerClassIsPerUser(metadata.containerClass())) return 0;
  if (std::optional<uint32_t> asked = QRVContentProtectionClassInInfo(metadata.info())) return *asked;
  return services_->dataProtection->intendedDataProtectionClassBasedOnEntitlementsForIdentifier(metadata.identifier());
}

bool QRVClientConnection::_createSubDirectories(const std::string& url, const QRVMetadata& metadata,
                                                QRVError* error) {
  QRVContainerClass c = metadata.containerClass();
  uid_t owner = QRVContainerClassIsBundle(c)   ? CONTAINER_INSTALLATION_UID
                : QRVContainerClassIsSystem(c) ? QRVFileManager::kSystemContainerOwner
                                               : metadata.userIdentity()->posixUIDForContainerClass(c);
  std::vector<std::string> names = services_->platform.fileSystem->defaultSubdirectories(c);
  uint32_t protectionClass = _dataProtectionClassForContainerMetadata(metadata);
  QRVLogDebug("Creating subdirectories for [{}:{}] at [{}]", c, metadata.identifier(), url);
  const auto& excluded = QRVGlobalConfiguration::excludedFromAppUserData();
  for (const std::string& name : names) {
    uint32_t cls = protectionClass;
    if (QRVContainerClassIsPerUser(c) && std::find(excluded.begin(), excluded.end(), name) != excluded.end()) cls = 0;
    // Class 0 asks for no class: the directory gets none.
    uint32_t toSet = cls == 0 ? QRVFileManager::kLeaveProtectionClassAlone : cls;
    std::string path = url + "/" + name;
    QRVError underlying;
    if (!services_->fileManager->createDirectoryBelowURL(url, name, 0755, owner, toSet, &underlying))
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kSubdirectoryNotCreated, underlying,
                                                 "Failed to create sub-dir for {} at {} (protClass: {})",
                                                 metadata.identifier(), path, cls));
  }
  return true;
}

// The new subdirectories' entries reach the disk before the container goes
// live: after a power loss a live container has its whole structure. Every
// directory that received one is flushed, the container's own last.
bool QRVClientConnection::_synchronizeSubDirectories(const std::string& url, QRVContainerClass containerClass,
                                                     QRVError* error) {
  std::set<std::string> parents;
  for (const std::string& name : services_->platform.fileSystem->defaultSubdirectories(containerClass))
    for (size_t slash = name.find('/'); slash != std::string::npos; slash = name.find('/', slash + 1))
      parents.insert(name.substr(0, slash));
  std::vector<std::string> directories;
  for (const std::string& parent : parents) directories.push_back(url + "/" + parent);
  directories.push_back(url);
  for (const std::string& directory : directories) {
    QRVError underlying;
    if (!services_->fileManager->synchronizeDirectoryAtURL(directory, &underlying))
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kSubdirectoryNotCreated, underlying,
                                                 "Failed to flush the subdirectories at {}", directory));
  }
  return true;
}

QRVMetadataRef QRVClientConnection::createOrLookupContainerWithContainerIdentity(
    const QRVContainerIdentityRef& containerIdentity, bool createIfNecessary, bool transient, bool useLocking,
    QRVError* error) {
  if (!containerIdentity) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "Cannot lookup a nil container identity."));
    return nullptr;
  }
  const std::string& identifier = containerIdentity->identifier();
  const QRVContainerClass containerClass = containerIdentity->containerClass();
  const std::string& caller = clientIdentity_->bundleIdentifier();
  QRVWellKnownNames& wellKnown = *services_->wellKnownNames;

  bool allowed = identifier == caller || allowOtherIdLookup_ ||
                 ((containerClass == QRVContainerClassSystemGroup || containerClass == QRVContainerClassAppGroup) &&
                  allowGroupIdLookup_) ||
                 unrestricted_ || isEntitledForLookupWithClass(containerClass, identifier) ||
                 wellKnown.isLookupWhitelistedFromCodeSignIdentifier(caller, containerClass, identifier);
  if (!allowed) {
    QRVFail(error,
            QRV_ERROR(QRVResultCode::kNotEntitled, "{} not entitled to retrieve container class {} with identifier {}",
                      caller, containerClass, identifier));
    return nullptr;
  }
  // A system data container is only ever the caller's own, unless granted.
  if (containerClass == QRVContainerClassSystemData && !allowOtherIdLookup_ && !unrestricted_ &&
      !isEntitledForLookupWithClass(QRVContainerClassSystemData, identifier) &&
      !wellKnown.isLookupWhitelistedFromCodeSignIdentifier(caller, QRVContainerClassSystemData, identifier) &&
      !(services_->codeSigning->identifierHasSystemContainer(identifier) && identifier == caller)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kNotEntitled, "{} not entitled for system container with identifier {}",
                             caller, identifier));
    return nullptr;
  }

  QRVContainerCache& cache = *services_->containerCache;
  try {
    if (!transient) {
      std::optional<QRVGlobalReadLock> readLock;
      if (useLocking) readLock.emplace();
      QRVError lookupError;
      QRVMetadataRef found = cache.containerForContainerIdentity(*containerIdentity, /*transient=*/false,
                                                                 /*updateSandbox=*/true, &lookupError);
      if (found) return found->withExisted(true);
      if (!QRVContainerCache::isNotFoundError(lookupError)) {
        QRVFail(error, lookupError);
        return nullptr;
      }
    }
    if (!createIfNecessary) {
      // Transient containers are never merely looked up.
      QRVFail(error, QRV_ERROR_QUIET(QRVResultCode::kNoSuchContainer, "Container with identifier: \"{}\" Not Found",
                                     identifier));
      return nullptr;
    }

    std::optional<QRVGlobalWriteLock> writeLock;
    if (useLocking) writeLock.emplace();
    QRVError lookupError;
    QRVMetadataRef found = cache.containerForContainerIdentity(*containerIdentity, transient, true, &lookupError);
    if (found && !transient) return found->withExisted(true);  // created by someone else meanwhile
    if (found) {
      // A transient request always gets a fresh, empty container.
      QRVError moveError;
      if (!_moveItemAtURLToDeathRow(found->url(), /*isDir=*/true, /*startDeletionThread=*/true, &moveError)) {
        QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kTransientNotRemoved, moveError,
                                            "Failed to remove transient container at {}", found->url()));
        return nullptr;
      }
    } else if (!QRVContainerCache::isNotFoundError(lookupError)) {
      QRVFail(error, lookupError);
      return nullptr;
    }

    QRVGlobalConfiguration& config = *services_->globalConfiguration;
    QRVFileManager& fm = *services_->fileManager;
    const QRVUserIdentityRef& userIdentity = containerIdentity->userIdentity();
    const QRVUUID uuid = QRVUUID::random();
    const std::string staging = config.stagingDirectoryURLForUserIdentity(userIdentity, containerClass) + "/" +
                                uuid.string();
    QRVError step;
    // A creation that fails often failed for want of space, which the half
    // built directory holds: it goes to death row at once, and death row is
    // emptied, rather than waiting in staging for the next start. Where even
    // that fails it is removed in place. False when it is still there.
    auto discardStaging = [&](QRVError* discardError) {
      QRVError deathRowError;
      if (_moveItemAtURLToDeathRow(staging, /*isDir=*/true, /*startDeletionThread=*/true, &deathRowError)) return true;
      return fm.removeItemAtURL(staging, discardError);
    };
    if (!_createTopLevelContainerDirectory(staging, containerClass, userIdentity->posixUIDForContainerClass(containerClass),
                                           &step)) {
      QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kStagingNotCreated, step,
                                          "Failed to create staging dir at \"{}\": {}", staging, step.description()));
      discardStaging(nullptr);
      return nullptr;
    }
    QRVCrashPoint(*services_, "create.staged");
    QRVConcreteContainerIdentityRef concrete =
        QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid, userIdentity, identifier, containerClass, &step);
    if (!concrete) {
      QRVFail(error, step);
      discardStaging(nullptr);
      return nullptr;
    }
    QRVMetadataRef metadata = QRVMetadata::make(*concrete, QRVPlist(), staging, "");
    if (!metadata->writeMetadataToDisk(fm, config, &step) ||
        (QRVContainerClassIsSystem(containerClass) && !fm.setTopLevelSystemContainerACLAtURL(staging, &step)) ||
        !_createSubDirectories(staging, *metadata, &step) ||
        !_synchronizeSubDirectories(staging, containerClass, &step)) {
      QRVFail(error, step);
      discardStaging(nullptr);
      return nullptr;
    }
    QRVCrashPoint(*services_, "create.metadata-written");

    std::optional<std::string> parent = config.containerDirectoryURLForUserIdentity(userIdentity, containerClass,
                                                                                    transient);
    if (!parent) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Invalid object: container class = {}", containerClass));
      discardStaging(nullptr);
      return nullptr;
    }
    std::optional<std::string> wellKnownName;
    if (QRVContainerClassIsSystem(containerClass)) {
      wellKnownName = containerClass == QRVContainerClassSystemGroup || containerClass == QRVContainerClassAppGroup
                          ? wellKnown.wellknownSystemGroupContainerForId(identifier)
                          : wellKnown.wellknownSystemContainerForId(identifier);
    }
    const std::string live = *parent + "/" + (wellKnownName ? *wellKnownName : uuid.string());
    if (!fm.moveItemAtURL(staging, live, &step)) {
      QRVError moveError = QRV_ERROR_UNDERLYING(QRVResultCode::kNotMovedLive, step,
                                                "Failed to move staging dir: {} to live dir: {}", staging, live);
      if (!discardStaging(&step))
        moveError =
            QRV_ERROR_UNDERLYING(QRVResultCode::kStagingNotRemoved, step, "Failed to remove staging dir: {}", staging);
      QRVFail(error, moveError);
      return nullptr;
    }
    QRVCrashPoint(*services_, "create.live");
    // With fast sizing, the size accounting of the new container starts now.
    // A failure (logged) only leaves the first real measurement to do it.
    if (services_->platform.featureFlags->isEnabled("quorvad", "fast_container_sizing"))
      fm.fastDiskUsageForURL(live, nullptr);

    metadata = metadata->withURL(live)->withExisted(false)->withTransient(transient);
    if (!cache.addContainerMetadata(metadata, live, transient, true, &step)) {
      QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kCacheAddFailed, step,
                                          "Failed to add to cache: {}, url: {}, transient: {}", concrete->description(),
                                          live, transient ? 1 : 0));
      return nullptr;
    }
    return metadata;
  } catch (...) {
    if (services_->globalConfiguration->isInternalImage()) QRVReportUncaughtException(std::current_exception());
    QRVFail(error, QRV_ERROR(QRVResultCode::kException, "Got exception: {} : {}",
                             QRVExceptionDescription(std::current_exception()), "(no call stack)"));
    return nullptr;
  }
}

QRVMetadataRef QRVClientConnection::metadataWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity,
                                                                  QRVError* error) {
  QRVMetadataRef metadata = createOrLookupContainerWithContainerIdentity(
      containerIdentity, /*createIfNecessary=*/false, /*transient=*/false, /*useLocking=*/true, error);
  if (metadata && containerIdentity->uuid() && metadata->uuid() != *containerIdentity->uuid()) {
    // The identifier has a container, but not the one the caller named.
    QRVFail(error, QRV_ERROR_QUIET(QRVResultCode::kNoSuchContainer, "Container with identifier: \"{}\" Not Found",
                                   containerIdentity->identifier()));
    return nullptr;
  }
  return metadata;
}

std::optional<std::vector<QRVMetadataRef>> QRVClientConnection::containersWithClass(QRVContainerClass containerClass,
                                                                                      bool transient,
                                                                                      QRVError* error) {
  if (!QRVContainerClassIsValid(containerClass)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Invalid object: container class = {}", containerClass));
    return std::nullopt;
  }
  QRVUserIdentityRef userIdentity = QRVUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)
                                        ? clientIdentity_->userIdentity()
                                        : services_->userIdentityCache->defaultUserIdentity();
  QRVGlobalReadLock lock;
  return services_->containerCache->allContainersForUserIdentity(userIdentity, containerClass, transient, error);
}

bool QRVClientConnection::recreateDefaultStructureWithContainerIdentity(
    const QRVContainerIdentityRef& containerIdentity, QRVError* error) {
  QRVMetadataRef metadata = metadataWithContainerIdentity(containerIdentity, error);
  if (!metadata) return false;
  if (!_createSubDirectories(metadata->url(), *metadata, error)) return false;
  if (QRVContainerClassIsSystem(metadata->containerClass()))
    return services_->fileManager->standardizeACLsForSystemContainerAtURL(metadata->url(), error);
  return true;
}
