// The user identities of the device's personas, and which one applies to a
// uid, a persona, a persona unique string or a bundle identifier.
//
// The maps are built from the platform persona service on first use and kept
// until the service reports a change of the persona list, which flushes them;
// the next question rebuilds them. All maps live under one lock.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <unordered_set>
#include <vector>

#include "base/QRVMutex.h"
#include "base/QRVSerialQueue.h"
#include "model/QRVUserIdentity.h"
#include "platform/QRVPersonaService.h"

class QRVUserIdentityCache {
 public:
  struct Options {
    // Ids of the account "mobile": what a uid below 501 stands for.
    uid_t mobileUID = QRVUserIdentity::kMinimumUID;
    gid_t mobileGID = QRVUserIdentity::kMinimumUID;
    // The home directory of a uid, as a path on this machine.
    std::function<std::string(uid_t)> homeDirectoryForUID;
    // Where a persona's home (a path inside the root) lies on this machine.
    std::function<std::string(const std::string&)> pathUnderRoot;
    // Pause between attempts to read an empty persona list.
    std::chrono::milliseconds retryInterval{1000};
  };

  QRVUserIdentityCache(std::shared_ptr<QRVPersonaService> personas, Options options);
  ~QRVUserIdentityCache();

  // Subscribes to persona-list changes. Separate from construction so that a
  // cache can be used without a live persona source.
  void registerForPersonaListUpdates();
  void unregister();

  // The identity a caller with these ids acts as, taking the calling
  // thread's current persona into account.
  QRVUserIdentityRef userIdentityForCurrentContextWithUID(uid_t uid, gid_t gid);
  // The same for the mobile account.
  QRVUserIdentityRef userIdentityForCurrentContext();
  // The mobile account (uid/gid 501), personal, with its home. Never null.
  QRVUserIdentityRef defaultUserIdentity() const { return defaultIdentity_; }
  // The personal identity of the mobile account, as older clients that knew
  // no personas meant it.
  QRVUserIdentityRef userIdentityForLegacyMobileUser();
  QRVUserIdentityRef userIdentityWithPersonaID(int32_t personaID);
  QRVUserIdentityRef userIdentityForPersonalPersonaWithUID(uid_t uid, gid_t gid);
  QRVUserIdentityRef userIdentityForPersonalPersona();
  QRVUserIdentityRef unspecificUserIdentity();
  QRVUserIdentityRef userIdentityForPersonaUniqueString(const std::string& uniqueString, uid_t uid, gid_t gid);
  QRVUserIdentityRef userIdentityForCurrentUserWithPersonaUniqueString(const std::string& uniqueString);
  bool isBundleIdentifier(const std::string& bundleIdentifier, const QRVUserIdentityRef& userIdentity);
  // The identities of the personas whose bundle list names the identifier.
  std::vector<QRVUserIdentityRef> userIdentitiesForBundleIdentifier(const std::string& bundleIdentifier);
  // Calls `block` for every known identity, personal first.
  void forEachAccessibleUserIdentitySynchronouslyExecuteBlock(const std::function<void(const QRVUserIdentityRef&)>& block);

  void flush();
  // Flushes and fills the maps with exactly these identities (tests and
  // start-up without a persona source): the first personal one becomes the
  // personal identity.
  void flushAndRepopulateWithUserIdentities(const std::vector<QRVUserIdentityRef>& identities);
  // The persona service's change callback.
  void personaListDidUpdate();

 private:
  void _lock_flush() REQUIRES(mutex_);
  void _lock_resyncIfNeeded() REQUIRES(mutex_);
  bool _lock_resync_fromUserPersonaAttributes(const std::vector<QRVPersona>& personas) REQUIRES(mutex_);
  QRVUserIdentityRef identityFromPersona(const QRVPersona& persona, bool forceUnspecific) const;
  // Below 501: the mobile account's ids.
  void applyUIDFloor(uid_t* uid, gid_t* gid) const;

  const std::shared_ptr<QRVPersonaService> personas_;
  const Options options_;
  QRVUserIdentityRef defaultIdentity_;
  std::shared_ptr<QRVSerialQueue> queue_;
  std::shared_ptr<QRVSerialQueue> observerQueue_;
  std::shared_ptr<bool> alive_;

  QRVMutex mutex_;
  bool cacheInvalid_ GUARDED_BY(mutex_) = true;
  bool personasSupported_ GUARDED_BY(mutex_) = false;
  std::map<int32_t, QRVUserIdentityRef> personaIDToUserIdentityMap_ GUARDED_BY(mutex_);
  std::map<std::string, QRVUserIdentityRef> personaUniqueStringToUserIdentityMap_ GUARDED_BY(mutex_);
  std::map<std::string, std::vector<QRVUserIdentityRef>> bundleToEnterpriseIdentitiesMap_ GUARDED_BY(mutex_);
  QRVUserIdentityRef userIdentityForPersonalPersona_ GUARDED_BY(mutex_);
  QRVUserIdentityRef userIdentityForUnspecificPersona_ GUARDED_BY(mutex_);
  std::vector<QRVPersona> lastPersonas_ GUARDED_BY(mutex_);
};
