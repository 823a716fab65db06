#include "model/QRVContainerCache.h"

#include <algorithm>
#include <cerrno>
#include <exception>

#include "base/QRVLog.h"
#include "base/QRVParallelFor.h"
#include "core/QRVExceptionReporter.h"
#include "fs/QRVDictionaryAdditions.h"
#include "fs/QRVFileManager.h"
#include "fs/QRVOpenDirectory.h"
#include "model/QRVGlobalConfiguration.h"
#include "users/QRVUserIdentityCache.h"

namespace {

const char* transientSuffix(bool transient) { return transient ? "(transient)" : ""; }

// A user identity in a log line is written out in full.
std::string describe(const QRVUserIdentityRef& u) { return u ? u->description() : "(null)"; }

const char* classDirectory(QRVContainerClass c) {
  const char* directory = QRVContainerClassRelativeDirectory(c);
  return directory ? directory : "(null)";
}

// Data containers, whose mappings follow the application's personas: 2, 4,
// 6, 9, 10, 11.
bool isDataClassForSandbox(QRVContainerClass c) { return c < 12 && ((0xe54ULL >> c) & 1); }

// A build keeps this many metadata reads in flight: with a cold page cache
// the disk answers several at once much faster than one after another. A
// class of a few dozen containers is read on the building thread alone,
// which is cheaper than starting a thread.
constexpr size_t kBuildThreads = 8;
constexpr size_t kContainersPerBuildThread = 32;

// Whether a read failed because the process ran short of descriptors or
// memory, which says nothing about the container.
bool isResourceExhaustion(const QRVError* error) {
  for (; error; error = error->underlying())
    if (error->isPOSIX() && (error->code() == EMFILE || error->code() == ENFILE || error->code() == ENOMEM))
      return true;
  return false;
}

}  // namespace

QRVContainerCache::QRVContainerCache(std::shared_ptr<QRVFileManager> fileManager,
                                     std::shared_ptr<QRVGlobalConfiguration> globalConfiguration,
                                     std::shared_ptr<QRVUserIdentityCache> userIdentityCache,
                                     std::shared_ptr<QRVSandbox> sandbox,
                                     std::shared_ptr<QRVPluginParentResolver> pluginParentResolver,
                                     std::shared_ptr<QRVWellKnownNames> wellKnownNames)
    : fileManager_(std::move(fileManager)),
      globalConfiguration_(std::move(globalConfiguration)),
      userIdentityCache_(std::move(userIdentityCache)),
      sandbox_(std::move(sandbox)),
      pluginParentResolver_(pluginParentResolver ? std::move(pluginParentResolver)
                                                 : std::make_shared<QRVNoPluginParentResolver>()),
      wellKnownNames_(wellKnownNames ? std::move(wellKnownNames) : std::make_shared<QRVNoWellKnownNames>()) {}

// ---- The lock ----

QRVContainerCache::Locker::Locker(QRVContainerCache& cache) : cache_(cache) {
  cache.cacheLock_.lock();
  cache_.cacheLockHolder_.store(std::this_thread::get_id(), std::memory_order_relaxed);
}

QRVContainerCache::Locker::~Locker() {
  cache_.cacheLockHolder_.store(std::thread::id(), std::memory_order_relaxed);
  cache_.cacheLock_.unlock();
}

void QRVContainerCache::_lock_release() {
  _lock_assertHeld();
  cacheLockHolder_.store(std::thread::id(), std::memory_order_relaxed);
  cacheLock_.unlock();
}

void QRVContainerCache::reacquireLock() {
  cacheLock_.lock();
  cacheLockHolder_.store(std::this_thread::get_id(), std::memory_order_relaxed);
}

void QRVContainerCache::_lock_waitForABuildToEnd() {
  _lock_assertHeld();
  cacheLockHolder_.store(std::thread::id(), std::memory_order_relaxed);
  buildEnded_.wait(&cacheLock_);
  cacheLockHolder_.store(std::this_thread::get_id(), std::memory_order_relaxed);
}

void QRVContainerCache::_lock_assertHeld() const {
  // Only the holder itself can see its own id here, so relaxed is enough.
  if (cacheLockHolder_.load(std::memory_order_relaxed) != std::this_thread::get_id())
    QRVTerminate("QRVContainerCache: the cache lock is not held by this thread");
}

// ---- Keys and entries ----

std::string QRVContainerCache::cacheKey(const QRVUserIdentityRef& userIdentity, QRVContainerClass contentClass) {
  if (!QRVContainerClassIsValid(contentClass)) return "";
  const char* directory = QRVContainerClassRelativeDirectory(contentClass);
  if (!QRVUserIdentity::isUserIdentityRequiredForContainerClass(contentClass)) return directory;
  if (!userIdentity) return "";
  return fmt::format("[{}]-{}", userIdentity->identifier(), directory);
}

bool QRVContainerCache::containerURL(const std::string& url, QRVContainerClass isValidForContainerClass) {
  const std::string name = QRVLastPathComponent(url);
  if (QRVUUID::fromString(name)) return true;
  if (isValidForContainerClass == QRVContainerClassSystemData) return wellKnownNames_->systemContainerIdIsWellknown(name);
  if (isValidForContainerClass == QRVContainerClassSystemGroup)
    return wellKnownNames_->systemGroupContainerIdIsWellknown(name);
  return false;
}

QRVContainerCache::ClassMap* QRVContainerCache::_lock_existingCacheForUserIdentity(
    const QRVUserIdentityRef& userIdentity, QRVContainerClass contentClass, bool transient) {
  _lock_assertHeld();
  const std::string key = cacheKey(userIdentity, contentClass);
  while (_lock_building(transient).count(key)) _lock_waitForABuildToEnd();
  auto& maps = _lock_maps(transient);
  auto it = maps.find(key);
  return it == maps.end() ? nullptr : &it->second;
}

QRVContainerCache::ClassMap* QRVContainerCache::_lock_getCacheForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                                              QRVContainerClass contentClass,
                                                                              bool transient,
                                                                              bool populateSandboxCache,
                                                                              QRVError* error) {
  _lock_assertHeld();
  const std::string key = cacheKey(userIdentity, contentClass);
  if (key.empty()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Cache: cannot index class {} for user identity {}",
                             contentClass, describe(userIdentity)));
    return nullptr;
  }
  auto& maps = _lock_maps(transient);
  std::set<std::string>& building = _lock_building(transient);
  for (;;) {
    if (auto it = maps.find(key); it != maps.end()) return &it->second;
    // Whether another thread's build succeeds or fails, this thread looks
    // again: a failed build leaves nothing, and then this one builds.
    if (!building.count(key)) break;
    _lock_waitForABuildToEnd();
  }

  building.insert(key);
  std::optional<ClassMap> built;
  // An exception is held until the key is no longer marked, so that the
  // threads waiting for this build wake up and build again.
  // Nothing between the two lock calls can throw.
  std::exception_ptr failure;
  _lock_release();
  try {
    built = buildClassMap(userIdentity, contentClass, transient, key, error);
  } catch (...) {
    failure = std::current_exception();
  }
  reacquireLock();
  building.erase(key);
  buildEnded_.signalAll();
  if (failure) std::rethrow_exception(failure);
  if (!built) return nullptr;
  ClassMap& stored = maps[key] = std::move(*built);
  if (populateSandboxCache)
    for (auto& [identifier, entry] : stored) _lock_registerWithSandboxIfNeeded(&entry, userIdentity, contentClass);
  return &stored;
}

std::optional<QRVContainerCache::ClassMap> QRVContainerCache::buildClassMap(const QRVUserIdentityRef& userIdentity,
                                                                            QRVContainerClass contentClass,
                                                                            bool transient, const std::string& key,
                                                                            QRVError* error) {
  QRVLogDebug("RebuildingCache: class {}", contentClass);
  std::optional<std::string> directoryURL =
      globalConfiguration_->containerDirectoryURLForUserIdentity(userIdentity, contentClass, transient);
  if (!directoryURL) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Cache: {}{}: no container directory", key,
                             transientSuffix(transient)));
    return std::nullopt;
  }
  std::unique_ptr<QRVOpenDirectory> directory = fileManager_->openDirectoryAtURL(*directoryURL, error);
  if (!directory) return std::nullopt;
  std::optional<std::vector<std::string>> entries = fileManager_->urlsForItemsInDirectory(*directory, error);
  if (!entries) return std::nullopt;

  struct Candidate {
    const std::string* url;
    std::string name;
    QRVMetadataRef metadata;
    QRVError readError;
  };
  std::vector<Candidate> candidates;
  for (const std::string& url : *entries)
    if (containerURL(url, contentClass)) candidates.push_back({&url, QRVLastPathComponent(url), nullptr, {}});

  // The class-path check keeps a container that was moved into another
  // class's tree out of this class's map. Files that do not validate were
  // logged by the reader and are not containers.
  QRVParallelFor(candidates.size(), kBuildThreads, kContainersPerBuildThread, [&](size_t i) {
    Candidate& c = candidates[i];
    c.metadata = QRVMetadata::readAndValidateMetadataBelowDirectory(*directory, c.name, userIdentity, true,
                                                                    *fileManager_, *userIdentityCache_, &c.readError);
    return c.metadata || !isResourceExhaustion(&c.readError);
  });
  for (Candidate& c : candidates)
    if (!c.metadata && isResourceExhaustion(&c.readError)) {
      QRVFail(error, std::move(c.readError));
      return std::nullopt;
    }

  ClassMap map;
  for (Candidate& c : candidates) {
    if (!c.metadata) continue;
    QRVMetadataRef metadata = std::move(c.metadata);
    if (metadata->containerClass() != contentClass) {
      QRVLogError("Cache: {}{}: {} holds a container of class {}; skipped", key, transientSuffix(transient), *c.url,
                  metadata->containerClass());
      continue;
    }
    if (transient) metadata = metadata->withTransient(true);
    auto [it, inserted] = map.try_emplace(metadata->identifier());
    if (!inserted)
      QRVLogError("Cache: {}{}: {} and {} both claim identifier {}; keeping the latter", key,
                  transientSuffix(transient), it->second.metadata->url(), *c.url, metadata->identifier());
    it->second = Entry{std::move(metadata), {}};
  }
  return map;
}

// ---- Lookups ----

QRVMetadataRef QRVContainerCache::containerForContainerIdentity(const QRVContainerIdentity& containerIdentity,
                                                                QRVError* error) {
  return containerForContainerIdentity(containerIdentity, /*transient=*/false, /*updateSandbox=*/false, error);
}

QRVMetadataRef QRVContainerCache::containerForContainerIdentity(const QRVContainerIdentity& containerIdentity,
                                                                bool transient, bool updateSandbox, QRVError* error) {
  try {
    QRVMetadataRef metadata;
    {
      Locker lock(*this);
      metadata = _lock_containerForContainerIdentity(containerIdentity, transient, updateSandbox, error);
    }
    if (!metadata) return nullptr;
    // The disk is the truth: a container whose metadata file has gone is not
    // handed out. The check is a system call, made without the lock, which
    // every look-up of every class would otherwise queue behind.
    const bool present = fileManager_->itemExistsAtURL(metadata->metadataFileURL());
    Locker lock(*this);
    return _lock_confirmContainer(containerIdentity, metadata, present, transient, updateSandbox, error);
  } catch (...) {
    // The lock is released by now. On an internal build the crash report is
    // worth more than the request.
    if (globalConfiguration_->isInternalImage()) QRVReportUncaughtException(std::current_exception());
    std::string what = "unknown exception";
    try {
      throw;
    } catch (const std::exception& e) {
      what = e.what();
    } catch (...) {
    }
    QRVFail(error, QRV_ERROR(QRVResultCode::kException, "Got exception: {} : {}", what, "(no call stack)"));
    return nullptr;
  }
}

QRVMetadataRef QRVContainerCache::_lock_containerForContainerIdentity(const QRVContainerIdentity& containerIdentity,
                                                                      bool transient, bool updateSandbox,
                                                                      QRVError* error) {
  const QRVUserIdentityRef& userIdentity = containerIdentity.userIdentity();
  const QRVContainerClass contentClass = containerIdentity.containerClass();
  const std::string& identifier = containerIdentity.identifier();
  const std::string key = cacheKey(userIdentity, contentClass);
  const char* suffix = transientSuffix(transient);

  QRVError buildError;
  ClassMap* map = _lock_getCacheForUserIdentity(userIdentity, contentClass, transient, updateSandbox, &buildError);
  if (!map) {
    QRVFail(error,
            QRV_ERROR_UNDERLYING(QRVResultCode::kCacheRebuildFailed, buildError, "Cache: [{}]-{}{}: Failed to rebuild",
                                 describe(userIdentity), classDirectory(contentClass), suffix));
    return nullptr;
  }
  auto it = map->find(identifier);
  if (it == map->end()) {
    QRVFail(error, QRV_ERROR_DEBUG(QRVResultCode::kNoSuchContainer, "Cache: {}{}: Container Not Found with ID: {}", key,
                                   suffix, identifier));
    return nullptr;
  }
  const QRVMetadataRef metadata = it->second.metadata;
  const std::string& url = metadata->url();
  if (url.empty()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kCacheInvalidURL, "Cache: {}{}: nil URL from {}", key, suffix,
                             metadata->description()));
    return nullptr;
  }
  if (url.front() != '/' || url.find('\0') != std::string::npos) {
    QRVFail(error,
            QRV_ERROR(QRVResultCode::kCacheInvalidURL, "Cache: {}{}: Invalid URL path string: {}", key, suffix, url));
    return nullptr;
  }
  return metadata;
}

QRVMetadataRef QRVContainerCache::_lock_confirmContainer(const QRVContainerIdentity& containerIdentity,
                                                         const QRVMetadataRef& metadata, bool present, bool transient,
                                                         bool updateSandbox, QRVError* error) {
  const QRVUserIdentityRef& userIdentity = containerIdentity.userIdentity();
  const QRVContainerClass contentClass = containerIdentity.containerClass();
  const std::string& identifier = containerIdentity.identifier();
  const std::string key = cacheKey(userIdentity, contentClass);
  const char* suffix = transientSuffix(transient);
  // The entry may have changed while the lock was let go; only the entry
  // that was found is dropped or registered.
  ClassMap* map = _lock_existingCacheForUserIdentity(userIdentity, contentClass, transient);
  auto it = map ? map->find(identifier) : ClassMap::iterator();
  const bool current = map && it != map->end() && it->second.metadata == metadata;
  if (!present) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kCacheInconsistent,
                             "Cache: {}{}: INCONSISTENT-No Metadata at: {} for id: {}, class: {}", key, suffix,
                             metadata->metadataFileURL(), identifier, contentClass));
    // The next request rebuilds from the disk.
    if (current) {
      map->erase(it);
      QRVLogDebug("Cache: {}{}: Removed Identifier: {}", key, suffix, identifier);
    }
    return nullptr;
  }
  if (updateSandbox && current) _lock_registerWithSandboxIfNeeded(&it->second, userIdentity, contentClass);
  QRVLogDebug("Cache: {}{}: Found Identifier: {}", key, suffix, identifier);
  return metadata;
}

std::optional<std::vector<QRVMetadataRef>> QRVContainerCache::allContainersForUserIdentity(
    const QRVUserIdentityRef& userIdentity, QRVContainerClass contentClass, bool transient, QRVError* error) {
  return allContainersForUserIdentity(userIdentity, contentClass, transient, false, error);
}

std::optional<std::vector<QRVMetadataRef>> QRVContainerCache::allContainersForUserIdentity(
    const QRVUserIdentityRef& userIdentity, QRVContainerClass contentClass, bool transient, bool populateSandboxCache,
    QRVError* error) {
  Locker lock(*this);
  const char* suffix = transientSuffix(transient);
  QRVError buildError;
  ClassMap* map =
      _lock_getCacheForUserIdentity(userIdentity, contentClass, transient, populateSandboxCache, &buildError);
  if (!map) {
    QRVFail(error,
            QRV_ERROR_UNDERLYING(QRVResultCode::kCacheRebuildFailed, buildError, "Cache: [{}]-{}{}: Failed to rebuild",
                                 describe(userIdentity), classDirectory(contentClass), suffix));
    return std::nullopt;
  }
  const std::string key = cacheKey(userIdentity, contentClass);
  std::vector<QRVMetadataRef> all;
  all.reserve(map->size());
  for (auto& [identifier, entry] : *map) {
    if (populateSandboxCache) _lock_registerWithSandboxIfNeeded(&entry, userIdentity, contentClass);
    QRVLogDebug("Cache: {}{}: ALL Found Identifier: {}", key, suffix, identifier);
    all.push_back(entry.metadata);
  }
  return all;
}

// ---- Changes ----

bool QRVContainerCache::addContainerMetadata(const QRVMetadataRef& metadata, const std::string& url, bool transient,
                                             bool updateSandbox, QRVError* error) {
  if (!metadata)
    return QRVFail(error, QRV_ERROR(QRVResultCode::kCacheAddFailed, "Cache: cannot add a nil container at {}", url));
  const QRVUserIdentityRef& userIdentity = metadata->userIdentity();
  const QRVContainerClass contentClass = metadata->containerClass();
  const char* suffix = transientSuffix(transient);
  Locker lock(*this);
  QRVError buildError;
  ClassMap* map = _lock_getCacheForUserIdentity(userIdentity, contentClass, transient, false, &buildError);
  if (!map)
    return QRVFail(
        error, QRV_ERROR_UNDERLYING(QRVResultCode::kCacheAddFailed, buildError, "Cache: [{}]-{}{}: Failed to rebuild",
                                    describe(userIdentity), classDirectory(contentClass), suffix));
  QRVMetadataRef stored = metadata;
  if (stored->url() != url) stored = stored->withURL(url);
  if (stored->transient() != transient) stored = stored->withTransient(transient);

  Entry& entry = (*map)[metadata->identifier()];
  // New metadata of a container at the same place keeps what was pushed for
  // it; a container at a new place has to be pushed again.
  if (!entry.metadata || entry.metadata->url() != url) entry.sandboxHandled.clear();
  entry.metadata = std::move(stored);
  QRVLogDebug("Cache: {}{}: Added Identifier: {}", cacheKey(userIdentity, contentClass), suffix,
              metadata->identifier());
  if (updateSandbox) _lock_registerWithSandboxIfNeeded(&entry, userIdentity, contentClass);
  return true;
}

bool QRVContainerCache::removeContainerForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                       QRVContainerClass contentClass, const std::string& identifier,
                                                       bool transient, QRVError* error) {
  const std::string key = cacheKey(userIdentity, contentClass);
  if (key.empty())
    return QRVFail(
        error, QRV_ERROR(QRVResultCode::kCacheRemoveFailed, "Cache: cannot remove {} of class {} for user identity {}",
                         identifier, contentClass, describe(userIdentity)));
  Locker lock(*this);
  ClassMap* map = _lock_existingCacheForUserIdentity(userIdentity, contentClass, transient);
  // A map not built yet holds nothing to forget; it is built from disk later.
  if (map && map->erase(identifier))
    QRVLogDebug("Cache: {}{}: Removed Identifier: {}", key, transientSuffix(transient), identifier);
  return true;
}

// ---- The sandbox facility ----

bool QRVContainerCache::shouldRegisterSandboxMappingWithUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                                     const std::string& identifier,
                                                                     QRVContainerClass containerClass) {
  const bool enterprise = userIdentity && userIdentity->isEnterprise();
  bool isMulti = false;
  bool decision;
  std::string application = identifier;
  if (isDataClassForSandbox(containerClass)) {
    // A plug-in lives in its application's personas. Without a known parent
    // the plug-in's own identifier is asked about.
    if (containerClass == QRVContainerClassPluginData || containerClass == QRVContainerClassVPNPluginData) {
      if (std::optional<std::string> parent = pluginParentResolver_->parentIdentifierForChildIdentifier(identifier))
        application = *parent;
    }
    std::vector<QRVUserIdentityRef> installed = userIdentityCache_->userIdentitiesForBundleIdentifier(application);
    auto contains = [&](const QRVUserIdentityRef& u) {
      return u && std::any_of(installed.begin(), installed.end(),
                              [&](const QRVUserIdentityRef& i) { return i && i->isEqualToUserIdentity(*u); });
    };
    isMulti = installed.size() >= 2 && contains(userIdentityCache_->userIdentityForPersonalPersona());
    decision = isMulti ? !enterprise : contains(userIdentity);
  } else if (containerClass == QRVContainerClassAppGroup) {
    decision = true;
  } else {
    decision = !enterprise;
  }
  QRVLogInfo(
      "Deciding to register userIdentity: {}, identifier: {} ({}), containerClass: {} with sandbox: {} because "
      "isMulti: {}",
      describe(userIdentity), identifier, application, containerClass, decision ? 1 : 0, isMulti ? 1 : 0);
  return decision;
}

bool QRVContainerCache::_lock_shouldRegisterSandboxMappingWithUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                                           const std::string& identifier,
                                                                           QRVContainerClass containerClass) {
  _lock_assertHeld();
  return shouldRegisterSandboxMappingWithUserIdentity(userIdentity, identifier, containerClass);
}

void QRVContainerCache::_lock_registerWithSandboxIfNeeded(Entry* entry, const QRVUserIdentityRef& userIdentity,
                                                          QRVContainerClass containerClass) {
  _lock_assertHeld();
  const std::string who = userIdentity ? userIdentity->identifier() : "";
  // Taken once per identity while the entry lives, so lookups stay cheap. A
  // failed push is logged here rather than on every lookup; it is tried again
  // when the container is added at a new place or the map is rebuilt.
  if (!entry->sandboxHandled.insert(who).second) return;
  const std::string& identifier = entry->metadata->identifier();
  if (_lock_shouldRegisterSandboxMappingWithUserIdentity(userIdentity, identifier, containerClass) &&
      !setSandboxContainerMappingForUserIdentity(userIdentity, identifier, containerClass, entry->metadata->url()))
    QRVLogError("Failed to set container mapping during create/lookup operation of {}, {}", identifier,
                containerClass);
}

bool QRVContainerCache::setSandboxContainerMappingForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                                  const std::string& identifier,
                                                                  QRVContainerClass containerClass,
                                                                  const std::optional<std::string>& url) {
  if (QRVContainerClassIsBundle(containerClass)) return true;
  QRVSandboxUserStateItem item;
  if (isDataClassForSandbox(containerClass) || containerClass == QRVContainerClassAppGroup) {
    if (!userIdentity) {
      QRVLogError("Unsupported class for setting sandbox container mapping: {}", containerClass);
      return false;
    }
    item.itemType = containerClass == QRVContainerClassAppGroup ? QRVSandboxUserStateItem::kApplicationGroup
                                                                : QRVSandboxUserStateItem::kDataContainer;
    item.uid = userIdentity->posixUIDForContainerClass(containerClass);
  } else if (containerClass == QRVContainerClassSystemData) {
    item.itemType = QRVSandboxUserStateItem::kSystemData;
    item.uid = 0;
  } else if (containerClass == QRVContainerClassSystemGroup) {
    item.itemType = QRVSandboxUserStateItem::kSystemGroup;
    item.uid = 0;
  } else {
    QRVLogError("Unsupported class for setting sandbox container mapping: {}", containerClass);
    return false;
  }
  item.personaID = userIdentity ? static_cast<uint32_t>(userIdentity->kernelPersonaID()) : 0;
  item.identifier = identifier;
  const std::string path = url ? *url : "(null)";

  if (int rc = sandbox_->setUserStateItem(item)) {
    QRVLogError("Failed to remove mapping for user: {}, itemType: {}, identifier: {}, class: {}, path: {} : {}",
                item.uid, item.itemType, identifier, containerClass, path, rc);
    return false;
  }
  if (url) {
    item.path = *url;
    if (int rc = sandbox_->setUserStateItem(item)) {
      QRVLogError("Failed to set mapping for user: {}, itemType: {}, identifier {}, class: {}, path: {} : {}",
                  item.uid, item.itemType, identifier, containerClass, path, rc);
      return false;
    }
  }
  QRVLogInfo("Pushed user: {}, itemType: {}, identifier {}, class: {}, persona id: {}, path: {}", item.uid,
             item.itemType, identifier, containerClass, static_cast<int32_t>(item.personaID), path);
  return true;
}
