// The daemon's in-memory index of the containers on disk: for each user
// identity and container class, which identifier lives in which directory,
// with its metadata. A class's map is built on first use by listing the
// class directory and reading every container's metadata file; the create,
// replace and delete operations keep it current afterwards. Live and
// transient containers are indexed separately.
//
// The cache also decides when a container's path is pushed to the sandbox
// facility, so that the launcher can find a process's container.
//
// One per process (QRVServices::containerCache). Thread-safe: both maps live
// under one lock. Methods named `_lock_` require it (checked by clang's
// thread-safety analysis) and check at run time that the calling thread
// holds it. The lock is not held while a class directory is read: the thread
// that builds a map marks its key as being built, reads the directory
// without the lock (many metadata files at once) and takes the lock again
// only to publish the map. Every other class is served meanwhile; an
// operation on the class being built (lookup, listing, addition, removal)
// waits for the build to end and then goes on as usual, so that an addition
// or removal made while the disk was being read is applied to the map that
// was read, never lost under it. A failed build publishes nothing, and the
// next operation on that class builds again. A look-up's check that the
// container's metadata file is still on disk is made without the lock too.
// While the lock is held the cache calls the user identity cache, the seams
// and the sandbox facility, none of which may call back into it; the build
// calls the user identity cache and the seams from several threads. Callers
// that create containers additionally hold the global identifier locks,
// which order lookups against creations.
#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "base/QRVCondVar.h"
#include "base/QRVError.h"
#include "base/QRVMutex.h"
#include "model/QRVContainerCacheSeams.h"
#include "model/QRVContainerClass.h"
#include "model/QRVContainerIdentity.h"
#include "model/QRVMetadata.h"
#include "model/QRVUserIdentity.h"
#include "platform/QRVSandbox.h"

class QRVFileManager;
class QRVGlobalConfiguration;
class QRVUserIdentityCache;

class QRVContainerCache {
 public:
  // Codes of this component (QRVResultCode): kNoSuchContainer, an expected
  // outcome and therefore not logged; kCacheRebuildFailed;
  // kCacheInconsistent when the metadata file vanished (the entry is then
  // dropped, so the next look-up reads the disk); kCacheAddFailed;
  // kCacheRemoveFailed; kCacheInvalidURL.

  // Whether `error` is the cache's "no such container", an expected outcome.
  static bool isNotFoundError(const QRVError& error) {
    return error.domain() == QRVError::kDomain && error.code() == QRVResultCode::kNoSuchContainer;
  }

  // Null seams are replaced by the defaults that know nothing.
  QRVContainerCache(std::shared_ptr<QRVFileManager> fileManager,
                    std::shared_ptr<QRVGlobalConfiguration> globalConfiguration,
                    std::shared_ptr<QRVUserIdentityCache> userIdentityCache, std::shared_ptr<QRVSandbox> sandbox,
                    std::shared_ptr<QRVPluginParentResolver> pluginParentResolver = nullptr,
                    std::shared_ptr<QRVWellKnownNames> wellKnownNames = nullptr);

  // The container of `containerIdentity`. Fails with 43 when the class
  // directory cannot be read, 21 (not logged) when there is no such
  // container, 47 when the entry has no usable path, and 44 when its metadata
  // file has vanished from disk (the entry is then dropped, so the next
  // request sees the disk as it is). With `updateSandbox`, a container not
  // yet pushed to the sandbox facility for this user identity is pushed now
  // (when the decision says so); each container is pushed once per identity
  // while it stays in the cache, so repeated lookups cost nothing extra.
  QRVMetadataRef containerForContainerIdentity(const QRVContainerIdentity& containerIdentity, bool transient,
                                               bool updateSandbox, QRVError* error);
  // Live containers, without touching the sandbox facility.
  QRVMetadataRef containerForContainerIdentity(const QRVContainerIdentity& containerIdentity, QRVError* error);

  // Every container of one class, ordered by identifier; fails with 43.
  std::optional<std::vector<QRVMetadataRef>> allContainersForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                                          QRVContainerClass contentClass,
                                                                          bool transient, QRVError* error);
  // With `populateSandboxCache`, containers not yet pushed for this user
  // identity are pushed.
  std::optional<std::vector<QRVMetadataRef>> allContainersForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                                          QRVContainerClass contentClass,
                                                                          bool transient, bool populateSandboxCache,
                                                                          QRVError* error);

  // Records a new or moved container (or new metadata of a known one) under
  // the metadata's user identity, class and identifier, at `url`, replacing
  // any earlier entry of that identifier. The stored value carries `url` and
  // `transient`. With `updateSandbox` the container is pushed to the sandbox
  // facility when the decision says so. Fails with 45 when the class's map
  // cannot be built or the metadata names no valid class or owner.
  bool addContainerMetadata(const QRVMetadataRef& metadata, const std::string& url, bool transient,
                            bool updateSandbox, QRVError* error);
  // Forgets one container. Forgetting one the cache does not hold succeeds.
  // Fails with 46 for an invalid class or a missing user identity. The
  // sandbox mapping is left alone: the caller that deletes the container
  // removes it with setSandboxContainerMappingForUserIdentity and no URL.
  bool removeContainerForUserIdentity(const QRVUserIdentityRef& userIdentity, QRVContainerClass contentClass,
                                      const std::string& identifier, bool transient, QRVError* error);

  // Pushes the mapping of one container to the sandbox facility: first an
  // item without a path (which removes any earlier mapping), then, when `url`
  // is given, the item with the path. Bundle classes have no mappings (true,
  // nothing pushed); an unsupported class is false. Failures are logged.
  bool setSandboxContainerMappingForUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                 const std::string& identifier, QRVContainerClass containerClass,
                                                 const std::optional<std::string>& url);
  // Whether a container should be pushed: data containers only for the
  // identities that have the application (all but enterprise personas when
  // the application is installed in several personas including the personal
  // one; plug-ins count as their application), group containers always,
  // everything else unless the identity is an enterprise persona.
  bool shouldRegisterSandboxMappingWithUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                    const std::string& identifier, QRVContainerClass containerClass);

  // Whether the directory entry `url` may be a container of `containerClass`:
  // its name is a UUID, or, for system (group) containers, a well-known name.
  bool containerURL(const std::string& url, QRVContainerClass isValidForContainerClass);

  // The key of a class's map: "[<identity identifier>]-<class directory>"
  // for classes that need a user identity, the class directory alone for
  // the others. Empty for an invalid class or a missing identity.
  static std::string cacheKey(const QRVUserIdentityRef& userIdentity, QRVContainerClass contentClass);

 private:
  struct Entry {
    QRVMetadataRef metadata;
    // Identifiers of the user identities for which the sandbox decision has
    // been taken (and the mapping pushed when it said so).
    std::set<std::string> sandboxHandled;
  };
  using ClassMap = std::map<std::string, Entry>;

  // The cache lock, recording its holder so `_lock_` methods can check it.
  class SCOPED_CAPABILITY Locker {
   public:
    explicit Locker(QRVContainerCache& cache) ACQUIRE(cache.cacheLock_);
    ~Locker() RELEASE();
    Locker(const Locker&) = delete;
    Locker& operator=(const Locker&) = delete;

   private:
    QRVContainerCache& cache_;
  };
  // Let go of the lock for a stretch inside a Locker's scope, and take it
  // again. (A scoped unlocker would read better, but the analysis of the
  // clang we build with does not follow one.)
  void _lock_release() RELEASE(cacheLock_);
  void reacquireLock() ACQUIRE(cacheLock_);
  // Ends the process unless the calling thread holds the lock: the run-time
  // twin of the REQUIRES below, for builds the analysis never sees (g++).
  void _lock_assertHeld() const ASSERT_CAPABILITY(cacheLock_);
  // Sleeps, without the lock, until some build ends.
  void _lock_waitForABuildToEnd() REQUIRES(cacheLock_);

  // The maps of live or transient containers, and the keys of those being
  // built.
  std::unordered_map<std::string, ClassMap>& _lock_maps(bool transient) REQUIRES(cacheLock_) {
    return transient ? transientContainerCache_ : liveContainerCache_;
  }
  std::set<std::string>& _lock_building(bool transient) REQUIRES(cacheLock_) {
    return transient ? transientBuilding_ : liveBuilding_;
  }

  // Reads the class directory into a new map, without the lock: the
  // directory is listed, then the metadata files of the entries named like
  // containers are read and validated on a few threads, and the results are
  // taken in listing order. Nothing with the listing's error when the
  // directory cannot be read, or when the process runs out of descriptors
  // or memory while reading it (a map missing a container would answer "no
  // such container" for one that exists).
  std::optional<ClassMap> buildClassMap(const QRVUserIdentityRef& userIdentity, QRVContainerClass contentClass,
                                        bool transient, const std::string& key, QRVError* error);

  // The class's map, built from disk on first use; null with the listing's
  // error when the class directory cannot be read. With
  // `populateSandboxCache`, a map built now has its containers pushed.
  // Waits for a build of the same map by another thread; the lock is let go
  // while waiting and while building. The pointer stays valid while the lock
  // is held.
  ClassMap* _lock_getCacheForUserIdentity(const QRVUserIdentityRef& userIdentity, QRVContainerClass contentClass,
                                          bool transient, bool populateSandboxCache, QRVError* error)
      REQUIRES(cacheLock_);
  // The map when it is built, after waiting for a build in progress (which
  // may have read the disk before the caller's change); never builds.
  ClassMap* _lock_existingCacheForUserIdentity(const QRVUserIdentityRef& userIdentity, QRVContainerClass contentClass,
                                               bool transient) REQUIRES(cacheLock_);
  bool _lock_shouldRegisterSandboxMappingWithUserIdentity(const QRVUserIdentityRef& userIdentity,
                                                          const std::string& identifier,
                                                          QRVContainerClass containerClass) REQUIRES(cacheLock_);
  // Takes the sandbox decision for `entry` and `userIdentity` unless it was
  // taken before, and pushes the mapping when it says so.
  void _lock_registerWithSandboxIfNeeded(Entry* entry, const QRVUserIdentityRef& userIdentity,
                                         QRVContainerClass containerClass) REQUIRES(cacheLock_);
  // The entry of `containerIdentity`, its URL checked, or null with the
  // error; the metadata file's presence is checked by the caller, without
  // the lock, and handed to _lock_confirmContainer.
  QRVMetadataRef _lock_containerForContainerIdentity(const QRVContainerIdentity& containerIdentity, bool transient,
                                                     bool updateSandbox, QRVError* error) REQUIRES(cacheLock_);
  // Finishes a look-up: a container whose metadata file is not `present`
  // fails with 44 and its entry is dropped; otherwise it is registered with
  // the sandbox facility when asked. Either only while the entry still holds
  // `metadata`.
  QRVMetadataRef _lock_confirmContainer(const QRVContainerIdentity& containerIdentity, const QRVMetadataRef& metadata,
                                        bool present, bool transient, bool updateSandbox, QRVError* error)
      REQUIRES(cacheLock_);

  const std::shared_ptr<QRVFileManager> fileManager_;
  const std::shared_ptr<QRVGlobalConfiguration> globalConfiguration_;
  const std::shared_ptr<QRVUserIdentityCache> userIdentityCache_;
  const std::shared_ptr<QRVSandbox> sandbox_;
  const std::shared_ptr<QRVPluginParentResolver> pluginParentResolver_;
  const std::shared_ptr<QRVWellKnownNames> wellKnownNames_;

  // Not recursive: nothing called under it re-enters the cache.
  QRVMutex cacheLock_;
  std::atomic<std::thread::id> cacheLockHolder_{};
  std::unordered_map<std::string, ClassMap> liveContainerCache_ GUARDED_BY(cacheLock_);
  std::unordered_map<std::string, ClassMap> transientContainerCache_ GUARDED_BY(cacheLock_);
  std::set<std::string> liveBuilding_ GUARDED_BY(cacheLock_);
  std::set<std::string> transientBuilding_ GUARDED_BY(cacheLock_);
  // Signalled, under the lock, whenever a build ends, well or badly.
  QRVCondVar buildEnded_;
};
