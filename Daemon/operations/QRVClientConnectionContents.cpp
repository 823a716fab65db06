// Work inside one existing container: info values, the user-managed assets
// directory, shared content for system groups, disk usage and a new
// directory UUID.
//
// Everything below a container directory belongs to its user, who may have
// replaced any part of it with links by the time we look. Paths built from a
// client's relative path are therefore always resolved with
// realPathForURL(…, ifChildOfURL) against the resolved directory they must
// stay in, and checked once more by prefix before anything is changed.
#include <string.h>

#include <algorithm>
#include <exception>

#include "base/QRVLog.h"
#include "core/QRVExceptionReporter.h"
#include "core/QRVLocks.h"
#include "fs/QRVDictionaryAdditions.h"
#include "model/QRVContainerCache.h"
#include "operations/QRVClientConnection.h"

namespace {

// The size of a bundle container, recorded the first time it is measured:
// installed code does not change size until it is replaced.
constexpr const char* kStaticDiskUsageKey = "com.kelva.Verdane.StaticDiskUsage";
constexpr const char* kUserManagedAssetsPrefix = "com.kelva.UserManagedAssets.";
constexpr uint64_t kTestLockDiskUsage = 2;


bool isInside(const std::string& path, const std::string& directory) {
  return path.size() > directory.size() + 1 && path.compare(0, directory.size(), directory) == 0 &&
         path[directory.size()] == '/';
}

std::string deletingLastPathComponent(const std::string& path) {
  size_t slash = path.find_last_of('/');
  return slash == std::string::npos ? std::string() : path.substr(0, slash);
}

// Runs `body`; an exception becomes 40 (see QRVGuarded).
template <typename Result, typename Body>
Result guarded(QRVClientConnection& connection, QRVError* error, Result failed, Body body) {
  return QRVGuarded(connection.services().globalConfiguration->isInternalImage(), error, std::move(failed), body);
}

}  // namespace

QRVMetadataRef QRVClientConnection::_existingContainer(const QRVContainerIdentityRef& containerIdentity,
                                                       bool useLocking, QRVError* error) {
  QRVError lookupError;
  QRVMetadataRef metadata = createOrLookupContainerWithContainerIdentity(containerIdentity, /*createIfNecessary=*/false,
                                                                         /*transient=*/false, useLocking, &lookupError);
  if (metadata && containerIdentity->uuid() && metadata->uuid() != *containerIdentity->uuid()) metadata = nullptr;
  if (metadata) return metadata;
  if (lookupError.code() == 0 || QRVContainerCache::isNotFoundError(lookupError))
    QRVFail(error, QRV_ERROR(QRVResultCode::kNoSuchContainer, "No Container with identity: {}",
                             containerIdentity->description()));
  else
    QRVFail(error, lookupError);
  return nullptr;
}

bool QRVClientConnection::_storeMetadata(const QRVMetadataRef& metadata, QRVError* error) {
  if (!metadata->writeMetadataToDisk(*services_->fileManager, *services_->globalConfiguration, error)) return false;
  QRVError cacheError;
  if (!services_->containerCache->addContainerMetadata(metadata, metadata->url(), metadata->transient(), true,
                                                       &cacheError))
    return QRVFail(error,
                   QRV_ERROR_UNDERLYING(QRVResultCode::kCacheAddFailed, cacheError,
                                        "Failed to add to cache: {}, url: {}, transient: {}", metadata->description(),
                                        metadata->url(), metadata->transient() ? 1 : 0));
  return true;
}

// ---- Info values ----

std::optional<QRVPlist> QRVClientConnection::infoValueForKey(const QRVPlist& key,
                                                             const QRVContainerIdentityRef& containerIdentity,
                                                             bool useLocking, QRVError* error) {
  if (!key.isString()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "Can't get nil or non-KLString key: {}", key.description()));
    return std::nullopt;
  }
  return guarded<std::optional<QRVPlist>>(*this, error, std::nullopt, [&]() -> std::optional<QRVPlist> {
    QRVMetadataRef metadata = _existingContainer(containerIdentity, useLocking, error);
    if (!metadata) return std::nullopt;
    const QRVPlist* value = metadata->info().get(key.stringValue());
    if (!value) {
      QRVFail(error,
              QRV_ERROR(QRVResultCode::kInfoValueNotFound, "Didn't find info value for key: {}", key.stringValue()));
      return std::nullopt;
    }
    return *value;
  });
}

bool QRVClientConnection::setInfoValue(const QRVPlist& value, const QRVPlist& key,
                                       const QRVContainerIdentityRef& containerIdentity, bool useLocking,
                                       QRVError* error) {
  if (!key.isString())
    return QRVFail(error,
                   QRV_ERROR(QRVResultCode::kInvalidInput, "Can't set nil or non-KLString key: {}", key.description()));
  return guarded(*this, error, false, [&]() {
    // Read, change and write under one lock: two writers of different keys
    // must both see their value survive.
    std::optional<QRVGlobalWriteLock> lock;
    if (useLocking) lock.emplace();
    QRVMetadataRef metadata = _existingContainer(containerIdentity, false, error);
    if (!metadata) return false;
    QRVPlist info = metadata->info().isDictionary() ? metadata->info() : QRVPlist::dictionary();
    if (value.isNone())
      info.remove(key.stringValue());
    else
      info.set(key.stringValue(), value);
    return _storeMetadata(metadata->withInfo(std::move(info)), error);
  });
}

// ---- User-managed assets ----

std::optional<std::string> QRVClientConnection::userManagedAssetsPathWithContainerIdentity(
    const QRVContainerIdentityRef& containerIdentity, bool isRelative, bool createIfNecessary, bool* existed,
    QRVError* error) {
  if (!containerIdentity) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "Can't act on a nil container identity"));
    return std::nullopt;
  }
  const std::string& identifier = containerIdentity->identifier();
  if (!entitled_ && identifier != clientIdentity_->bundleIdentifier()) {
    QRVFail(error,
            QRV_ERROR(QRVResultCode::kInvalidInput, "{} trying to retrieve path for identifier: {} without entitlement",
                      clientIdentity_->bundleIdentifier(), identifier));
    return std::nullopt;
  }
  return guarded<std::optional<std::string>>(*this, error, std::nullopt, [&]() -> std::optional<std::string> {
    QRVMetadataRef metadata;
    if (createIfNecessary) {
      QRVError createError;
      metadata = createOrLookupContainerWithContainerIdentity(containerIdentity, /*createIfNecessary=*/true,
                                                              /*transient=*/false, /*useLocking=*/true, &createError);
      if (!metadata) {
        QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kInvalidObject, createError,
                                            "Failed to create app data container for user managed assets path for "
                                            "{}: {}",
                                            identifier, createError.description()));
        return std::nullopt;
      }
    } else {
      metadata = _existingContainer(containerIdentity, true, error);
      if (!metadata) return std::nullopt;
    }

    QRVFileManager& fm = *services_->fileManager;
    auto answer = [&](const QRVMetadata& m, bool wasThere) -> std::optional<std::string> {
      if (existed) *existed = wasThere;
      return isRelative ? m.userManagedAssetsDirName() : m.url() + "/" + m.userManagedAssetsDirName();
    };
    auto hasDirectory = [&](const QRVMetadata& m) {
      return !m.userManagedAssetsDirName().empty() && fm.itemExistsAtURL(m.url() + "/" + m.userManagedAssetsDirName());
    };
    if (metadata->url().empty()) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "No URL in container metadata object: {}",
                               metadata->description()));
      return std::nullopt;
    }
    if (hasDirectory(*metadata)) return answer(*metadata, true);
    if (!createIfNecessary) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kUserManagedPathNotFound, "User managed path for {}:{} Not Found",
                               identifier, containerIdentity->containerClass()));
      return std::nullopt;
    }

    // Another request may be creating the directory too: decide again under
    // the lock that also covers the metadata rewrite.
    QRVGlobalWriteLock lock;
    metadata = _existingContainer(containerIdentity, false, error);
    if (!metadata) return std::nullopt;
    if (hasDirectory(*metadata)) return answer(*metadata, true);

    QRVError step;
    std::optional<std::string> dir = fm.createTemporaryDirectoryInDirectoryURL(metadata->url(), kUserManagedAssetsPrefix,
                                                                               &step);
    if (!dir) {
      QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kSubdirectoryNotCreated, step,
                                          "Failed to create user managed assets dir at {}: {}", metadata->url(),
                                          step.description()));
      return std::nullopt;
    }
    // The file manager refuses a link put in the new directory's place.
    const QRVContainerClass c = metadata->containerClass();
    const uid_t uid = metadata->userIdentity()->posixUIDForContainerClass(c);
    const gid_t gid = metadata->userIdentity()->posixGIDForContainerClass(c);
    QRVError failure;
    if (!fm.setOwnerOfDirectoryAtURL(*dir, uid, gid, &step)) {
      failure = QRV_ERROR_UNDERLYING(QRVResultCode::kSubdirectoryNotCreated, step,
                                     "Failed to chown user managed assets dir at {}: {}", *dir,
                                     strerror(static_cast<int>(step.code())));
    } else if (!fm.setModeOfDirectoryAtURL(*dir, 0755, &step)) {
      failure = QRV_ERROR_UNDERLYING(QRVResultCode::kSubdirectoryNotCreated, step,
                                     "Failed to chmod user managed assets dir at {}: {}", *dir,
                                     strerror(static_cast<int>(step.code())));
    }
    QRVMetadataRef updated;
    if (failure.code() == 0) {
      updated = metadata->withUserManagedAssetsDirName(QRVLastPathComponent(*dir));
      if (!_storeMetadata(updated, &failure)) updated = nullptr;
    }
    if (!updated) {
      // Nothing names the directory, so it would only be litter.
      fm.removeItemAtURL(*dir, nullptr);
      QRVFail(error, failure);
      return std::nullopt;
    }
    return answer(*updated, false);
  });
}

bool QRVClientConnection::deleteUserManagedAssetWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity,
                                                                      const std::string& relativePath,
                                                                      QRVError* error) {
  // An absolute path is no relative path, whatever it would resolve to.
  if (!containerIdentity || relativePath.empty() || relativePath.front() == '/')
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Can't act on invalid input: ID: {}, Path: {}",
                                    containerIdentity ? containerIdentity->identifier() : "(null)", relativePath));
  return guarded(*this, error, false, [&]() {
    // The container may not move (new UUID, replace) while we work in it.
    QRVGlobalReadLock lock;
    QRVMetadataRef metadata = _existingContainer(containerIdentity, false, error);
    if (!metadata) return false;
    if (metadata->userManagedAssetsDirName().empty() || metadata->url().empty())
      return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject,
                                      "No userManagedAssetsDirName or URL in container metadata object: {}",
                                      metadata->description()));
    QRVFileManager& fm = *services_->fileManager;
    const std::string containerURL = metadata->url();
    // The assets directory itself must be the directory the metadata names,
    // not a link the user put in its place (even one to elsewhere in the
    // container: the client asked about assets, not about other content).
    std::optional<std::string> containerReal = fm.realPathForURL(containerURL, containerURL);
    std::optional<std::string> assets =
        fm.realPathForURL(containerURL + "/" + metadata->userManagedAssetsDirName(), containerURL);
    if (!containerReal || !assets || *assets != *containerReal + "/" + metadata->userManagedAssetsDirName())
      return QRVFail(error, QRV_ERROR(QRVResultCode::kUnexpectedPath, "Unable to get realpath for resource {}",
                                      containerURL + "/" + metadata->userManagedAssetsDirName()));

    // The asset is what the path resolves to, links included, and it must
    // exist: removing nothing is no success, since the client would believe
    // an asset gone that it only misnamed. The resolution refuses ".." and
    // links that leave the directory; the prefix check below refuses
    // anything else that is not strictly inside it.
    std::string path = relativePath;
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    const std::string resource = *assets + "/" + path;
    std::optional<std::string> target = fm.realPathForURL(resource, *assets);
    if (!target || !fm.itemExistsAtURL(*target))
      return QRVFail(error,
                     QRV_ERROR(QRVResultCode::kUnexpectedPath, "Unable to get realpath for resource {}", resource));
    if (*target == *assets)
      return QRVFail(error, QRV_ERROR(QRVResultCode::kUnexpectedPath,
                                      "Illegal attempt to delete user managed assets directory at {}", *assets));
    if (!isInside(*target, *assets))
      return QRVFail(error, QRV_ERROR(QRVResultCode::kUnexpectedPath,
                                      "Illegal attempt to delete asset not residing in user managed assets "
                                      "directory {}",
                                      *assets));
    QRVError removeError;
    if (!fm.removeItemAtURL(*target, &removeError))
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kDeathRowMoveFailed, removeError,
                                                 "Failed to remove asset at {}", *target));
    return true;
  });
}

// ---- Shared content for system groups ----

std::optional<std::string> QRVClientConnection::stageSharedContentForIdentifier(const std::string& identifier,
                                                                                const std::string& sourceRelativePath,
                                                                                const std::string& destRelativePath,
                                                                                QRVError* error) {
  if (identifier.empty() || sourceRelativePath.empty() || destRelativePath.empty()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Can't act on invalid input: ID: {}, source: {}, dest: {}",
                             identifier, sourceRelativePath, destRelativePath));
    return std::nullopt;
  }
  if (QRVContainsDotDotPathComponents(sourceRelativePath) || QRVContainsDotDotPathComponents(destRelativePath)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "Paths can't contain dots. source: {}, dest: {}",
                             sourceRelativePath, destRelativePath));
    return std::nullopt;
  }
  const std::string& caller = clientIdentity_->bundleIdentifier();
  std::vector<std::string> groups = services_->systemGroups->systemGroupIdentifiersForIdentifier(caller);
  if (std::find(groups.begin(), groups.end(), identifier) == groups.end()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kNotEntitled, "{} not entitled for system group container {}", caller,
                             identifier));
    return std::nullopt;
  }
  return guarded<std::optional<std::string>>(*this, error, std::nullopt, [&]() -> std::optional<std::string> {
    QRVUserIdentityRef systemUser = services_->userIdentityCache->defaultUserIdentity();
    QRVError step;
    // Both containers are found the way any look-up finds them, with the
    // caller's look-up rights: being allowed to stage into a group does not
    // make a caller entitled to find a container it could not look up.
    // Neither may be created here. A refusal passes through as it is.
    QRVGlobalReadLock lock;
    auto lookUp = [&](const std::string& id, QRVContainerClass containerClass) -> QRVMetadataRef {
      QRVContainerIdentityRef identity =
          QRVContainerIdentity::containerIdentityWithUserIdentity(systemUser, id, containerClass, &step);
      if (!identity) return nullptr;
      return createOrLookupContainerWithContainerIdentity(identity, /*createIfNecessary=*/false, /*transient=*/false,
                                                          /*useLocking=*/false, &step);
    };
    auto notFound = [&]() { return step.code() == 0 || QRVContainerCache::isNotFoundError(step); };
    QRVMetadataRef group = lookUp(identifier, QRVContainerClassSystemGroup);
    if (!group) {
      if (notFound())
        QRVFail(error,
                QRV_ERROR(QRVResultCode::kNoSuchContainer, "System group container with identifier {} not found: {}",
                          identifier, step.description()));
      else
        QRVFail(error, step);
      return std::nullopt;
    }
    step = QRVError();
    QRVMetadataRef own = lookUp(caller, QRVContainerClassSystemData);
    if (!own) {
      if (notFound())
        QRVFail(error, QRV_ERROR(QRVResultCode::kNoSuchContainer, "No Container with identity: {} (class {})", caller,
                                 QRVContainerClassSystemData));
      else
        QRVFail(error, step);
      return std::nullopt;
    }
    QRVFileManager& fm = *services_->fileManager;
    std::optional<std::string> source = fm.realPathForURL(own->url() + "/" + sourceRelativePath, own->url());
    if (!source || !isInside(*source, own->url())) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kUnexpectedPath, "Invalid source URL {} for {} at {}", sourceRelativePath,
                               caller, own->url()));
      return std::nullopt;
    }
    std::optional<std::string> dest = fm.realPathForURL(group->url() + "/" + destRelativePath, group->url());
    if (!dest || !isInside(*dest, group->url())) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kUnexpectedPath, "Invalid dest URL {} for {} at {}", destRelativePath,
                               identifier, group->url()));
      return std::nullopt;
    }
    // The item becomes content of the group container, not its top level:
    // it gets the ACLs of the entries inside one.
    if (!fm.standardizeACLsAtURL(*source, false, &step)) {
      QRVFail(error,
              QRV_ERROR_UNDERLYING(QRVResultCode::kACLsNotStandardized, step,
                                   "Failed to standardize ACLs for {} at {}: {}", caller, *source, step.description()));
      return std::nullopt;
    }
    if (!fm.moveItemAtURL(*source, *dest, &step)) {
      QRVFail(error,
              QRV_ERROR_UNDERLYING(QRVResultCode::kSharedContentNotMoved, step, "Failed move for {} from {} to: {}: {}",
                                   caller, *source, *dest, step.description()));
      return std::nullopt;
    }
    return dest;
  });
}

// ---- Disk usage ----

std::optional<uint64_t> QRVClientConnection::diskUsageWithContainerIdentity(
    const QRVContainerIdentityRef& containerIdentity, QRVError* error) {
  return guarded<std::optional<uint64_t>>(*this, error, std::nullopt, [&]() -> std::optional<uint64_t> {
    QRVError lookupError;
    QRVMetadataRef metadata = _existingContainer(containerIdentity, true, &lookupError);
    if (!metadata) {
      if (QRVContainerCache::isNotFoundError(lookupError))
        QRVLogError("No Container with identity: {}", containerIdentity ? containerIdentity->description() : "(null)");
      QRVFail(error, lookupError);
      return std::nullopt;
    }
    const QRVPlist* recorded = metadata->info().get(kStaticDiskUsageKey);
    if (recorded && recorded->type() == QRVPlist::Type::UInteger) return recorded->uint64Value();

    services_->testLocks->waitOnLock(kTestLockDiskUsage);
    // A tree that cannot be measured whole has no size to report: a partial
    // count (or 0) would be believed, and for a bundle recorded for good.
    // The failure is wrapped in a code of ours so that no errno (EPERM is 1)
    // can read as success.
    QRVError measureError;
    std::optional<uint64_t> usage = services_->fileManager->fastDiskUsageForURL(metadata->url(), &measureError);
    if (!usage) {
      QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kUnexpectedPath, measureError,
                                          "Failed to measure disk usage of {}: {}", metadata->url(),
                                          measureError.description()));
      return std::nullopt;
    }
    const uint64_t measured = *usage;
    if (QRVContainerClassIsBundle(metadata->containerClass())) {
      QRVError recordError;
      // A failure only costs a measurement next time; the answer stands.
      if (!setInfoValue(QRVPlist::uinteger(measured), QRVPlist::string(kStaticDiskUsageKey), containerIdentity, true,
                        &recordError))
        QRVLogError("Failed to record disk usage of {}: {}", metadata->url(), recordError.description());
    }
    return measured;
  });
}

// ---- New directory UUID ----

QRVMetadataRef QRVClientConnection::regenerateDirectoryUUIDWithContainerIdentity(
    const QRVContainerIdentityRef& containerIdentity, QRVError* error) {
  return guarded<QRVMetadataRef>(*this, error, nullptr, [&]() -> QRVMetadataRef {
    // The directory moves: nobody may be looking it up or working in it.
    QRVGlobalWriteLock lock;
    QRVMetadataRef metadata = _existingContainer(containerIdentity, false, error);
    if (!metadata) return nullptr;
    const std::string oldURL = metadata->url();
    const std::string name = QRVLastPathComponent(oldURL);
    if (!QRVUUID::fromString(name)) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Non-UUID last path component: {} for {}", name,
                               metadata->description()));
      return nullptr;
    }
    const QRVUUID uuid = QRVUUID::random();
    const std::string newURL = deletingLastPathComponent(oldURL) + "/" + uuid.string();
    QRVFileManager& fm = *services_->fileManager;
    QRVError step;
    if (!fm.moveItemAtURL(oldURL, newURL, &step)) {
      QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kNewUUIDMoveFailed, step,
                                          "Failed to move dir: {} to new UUID dir: {}", oldURL, newURL));
      return nullptr;
    }
    QRVMetadataRef updated = metadata->withURL(newURL)->withUUID(uuid);
    if (!updated->writeMetadataToDisk(fm, *services_->globalConfiguration, error)) {
      // The file still names the old UUID: put the directory back where the
      // cache and the file agree.
      QRVError backError;
      if (!fm.moveItemAtURL(newURL, oldURL, &backError))
        QRVLogError("Failed to move {} back to {}: {}", newURL, oldURL, backError.description());
      return nullptr;
    }
    // From here the disk is consistent under the new UUID; a cache that
    // failed to take it finds it again when it next reads the disk.
    if (!services_->containerCache->addContainerMetadata(updated, newURL, updated->transient(), true, &step)) {
      QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kCacheAddFailed, step,
                                          "Failed to add to cache: {}, url: {}, transient: {}", updated->description(),
                                          newURL, updated->transient() ? 1 : 0));
      return nullptr;
    }
    return updated;
  });
}
