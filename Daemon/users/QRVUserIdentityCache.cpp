#include "users/QRVUserIdentityCache.h"

#include <algorithm>
#include <thread>

#include "base/QRVLog.h"
#include "core/QRVCurrentPersona.h"
#include "core/QRVExceptionReporter.h"

#include <fmt/ranges.h>

namespace {

std::string describePersonas(const std::vector<QRVPersona>& personas) {
  std::string out = "(";
  for (const QRVPersona& p : personas) {
    if (out.size() > 1) out += ", ";
    out += fmt::format("{{id = {}; uid = {}; type = {}; unique = {}}}", p.personaID, p.uid, p.type, p.uniqueString);
  }
  return out + ")";
}

constexpr unsigned kMaximumResyncTries = 60;

}  // namespace

QRVUserIdentityCache::QRVUserIdentityCache(std::shared_ptr<QRVPersonaService> personas, Options options)
    : personas_(std::move(personas)), options_(std::move(options)), alive_(std::make_shared<bool>(true)) {
  std::string home = options_.homeDirectoryForUID ? options_.homeDirectoryForUID(QRVUserIdentity::kMinimumUID) : "";
  defaultIdentity_ = QRVUserIdentity::makeDefault(home);
  queue_ = QRVSerialQueue::create("com.kelva.quorvad.useridentitycache");
  observerQueue_ = QRVSerialQueue::create("com.kelva.quorvad.personaobserver");
  QRVMutexLock lock(&mutex_);
  _lock_flush();
}

QRVUserIdentityCache::~QRVUserIdentityCache() { unregister(); }

void QRVUserIdentityCache::registerForPersonaListUpdates() {
  if (!personas_) return;
  std::weak_ptr<bool> alive = alive_;
  personas_->observe([this, alive] {
    // The service calls from its own thread; the cache answers on its
    // observer queue, as long as it is still registered.
    observerQueue_->async([this, alive] {
      if (alive.lock()) personaListDidUpdate();
    });
  });
}

void QRVUserIdentityCache::unregister() { alive_.reset(); }

void QRVUserIdentityCache::personaListDidUpdate() {
  QRVLogNotice("Received persona list update");
  queue_->async([this] {
    QRVLogNotice("Flushing user identity cache for persona list update");
    flush();
  });
}

void QRVUserIdentityCache::applyUIDFloor(uid_t* uid, gid_t* gid) const {
  if (*uid < QRVUserIdentity::kMinimumUID) {
    *uid = options_.mobileUID;
    *gid = options_.mobileGID;
  }
}

QRVUserIdentityRef QRVUserIdentityCache::identityFromPersona(const QRVPersona& persona, bool forceUnspecific) const {
  std::string home = persona.home.empty()
                         ? (options_.homeDirectoryForUID ? options_.homeDirectoryForUID(persona.uid) : "")
                         : (options_.pathUnderRoot ? options_.pathUnderRoot(persona.home) : persona.home);
  uint32_t type = forceUnspecific ? QRVPersonaTypeNoSpecificPersona
                                  : (persona.type <= QRVPersonaTypeEnterprise ? persona.type
                                                                              : QRVPersonaTypeNoSpecificPersona);
  return QRVUserIdentity::make(persona.uid, persona.gid, home, persona.uniqueString, type,
                               static_cast<int32_t>(persona.personaID));
}

void QRVUserIdentityCache::_lock_flush() {
  cacheInvalid_ = true;
  personaIDToUserIdentityMap_.clear();
  personaUniqueStringToUserIdentityMap_.clear();
  bundleToEnterpriseIdentitiesMap_.clear();
  userIdentityForPersonalPersona_ = defaultIdentity_;
  userIdentityForUnspecificPersona_ = defaultIdentity_;
}

void QRVUserIdentityCache::flush() {
  QRVMutexLock lock(&mutex_);
  _lock_flush();
}

void QRVUserIdentityCache::flushAndRepopulateWithUserIdentities(const std::vector<QRVUserIdentityRef>& identities) {
  QRVMutexLock lock(&mutex_);
  _lock_flush();
  for (const auto& u : identities) {
    if (!u) continue;
    if (u->personaType() == QRVPersonaTypePersonal && userIdentityForPersonalPersona_ == defaultIdentity_) {
      userIdentityForPersonalPersona_ = u;
      continue;
    }
    personaIDToUserIdentityMap_[u->kernelPersonaID()] = u;
    if (!u->personaUniqueString().empty()) personaUniqueStringToUserIdentityMap_[u->personaUniqueString()] = u;
  }
  personasSupported_ = true;
  cacheInvalid_ = false;
}

void QRVUserIdentityCache::_lock_resyncIfNeeded() {
  if (!cacheInvalid_) return;
  personasSupported_ = personas_ && personas_->personasSupported();
  if (!personasSupported_) {
    cacheInvalid_ = false;
    return;
  }
  for (unsigned tries = 0;; tries++) {
    std::vector<QRVPersona> list = personas_->personas();
    QRVLogInfo("Got userPersonaAttributes: {} on try: {}", describePersonas(list), tries);
    if (!list.empty() && _lock_resync_fromUserPersonaAttributes(list)) break;
    if (list.empty() && tries == 0) {
      QRVLogError("Did not receive any persona attributes: {}", describePersonas(list));
      QRVLogError("Did not receive any persona attributes.");
    }
    if (tries == kMaximumResyncTries) {
      QRVLogError("Could not obtain persona attributes after exhausting retries, crashing");
      QRVTerminate("Could not obtain persona attributes after exhausting retries.");
    }
    std::this_thread::sleep_for(options_.retryInterval);
  }
  cacheInvalid_ = false;
}

bool QRVUserIdentityCache::_lock_resync_fromUserPersonaAttributes(const std::vector<QRVPersona>& personas) {
  std::map<int32_t, QRVUserIdentityRef> byID;
  std::map<std::string, QRVUserIdentityRef> byString;
  std::map<std::string, std::vector<QRVUserIdentityRef>> byBundle;
  QRVUserIdentityRef personal, unspecific;
  for (const QRVPersona& p : personas) {
    QRVLogInfo("Looking at universal={} system={} attributes: {}", p.isUniversal ? 1 : 0, p.isSystem ? 1 : 0,
               describePersonas({p}));
    QRVUserIdentityRef identity;
    if (p.type == QRVPersonaTypePersonal && !personal) {
      if (p.uniqueString.empty()) {
        QRVLogError("Invalid persona unique string for personal {}", describePersonas({p}));
        continue;
      }
      personal = identityFromPersona(p, false);
      unspecific = identityFromPersona(p, true);
      if (!personal || !unspecific) continue;
      QRVLogInfo("Found personal persona {}: created personal {}, unspecific {}", p.personaID, personal->description(),
                 unspecific->description());
      identity = personal;
    } else {
      if (p.uniqueString.empty()) {
        QRVLogError("Invalid persona unique string for {}", describePersonas({p}));
        continue;
      }
      identity = identityFromPersona(p, false);
      if (!identity) continue;
      byID[static_cast<int32_t>(p.personaID)] = identity;
      byString[p.uniqueString] = identity;
    }
    // The personal persona's list counts like any other: an application in
    // it and in an enterprise persona is installed in both.
    if (p.isUniversal || p.isSystem) {
      QRVLogInfo("Fetched bundle ID list for universal/system {}: ({})", p.uniqueString,
                 fmt::join(p.bundleIdentifiers, ", "));
      for (const std::string& bundle : p.bundleIdentifiers) byBundle[bundle].push_back(identity);
    }
  }
  if (!personal) {
    QRVLogError("Expected to find a personal persona in {}", describePersonas(personas));
    return false;
  }
  // The personal persona is found by id and string like any other.
  byID[personal->kernelPersonaID()] = personal;
  byString[personal->personaUniqueString()] = personal;
  personaIDToUserIdentityMap_ = std::move(byID);
  personaUniqueStringToUserIdentityMap_ = std::move(byString);
  bundleToEnterpriseIdentitiesMap_ = std::move(byBundle);
  userIdentityForPersonalPersona_ = personal;
  userIdentityForUnspecificPersona_ = unspecific;
  lastPersonas_ = personas;
  return true;
}

QRVUserIdentityRef QRVUserIdentityCache::userIdentityForCurrentContextWithUID(uid_t uid, gid_t gid) {
  applyUIDFloor(&uid, &gid);
  std::optional<uint32_t> persona = QRVCurrentPersona::get();
  QRVUserIdentityRef result;
  QRVMutexLock lock(&mutex_);
  _lock_resyncIfNeeded();
  if (!personasSupported_) {
    lock.unlock();
    result = userIdentityForPersonalPersonaWithUID(uid, gid);
    QRVLogDebug("({}/{}) Personas not supported, using: {}", uid, gid, result ? result->description() : "(null)");
    return result;
  }
  QRVUserIdentityRef known;
  if (persona) {
    auto it = personaIDToUserIdentityMap_.find(static_cast<int32_t>(*persona));
    if (it != personaIDToUserIdentityMap_.end()) known = it->second;
  }
  if (known && known->personaType() == QRVPersonaTypePersonal) {
    result = known->withUID(uid, gid);
    QRVLogDebug("({}/{}) Explicit personal persona, using: {}", uid, gid, result->description());
  } else if (known && known->isEnterprise() && !known->personaUniqueString().empty()) {
    result = known->withUID(uid, gid);
    QRVLogDebug("({}/{}) Looked up user identity for [{}]: {}", uid, gid, known->personaUniqueString(),
                result ? result->description() : "(null)");
  } else {
    result = userIdentityForUnspecificPersona_->withUID(uid, gid);
    QRVLogDebug("({}/{}) No persona (<{}>) or no unique string [{}], using: {}", uid, gid,
                persona ? std::to_string(*persona) : "0x0", known ? known->personaUniqueString() : "(null)",
                result ? result->description() : "(null)");
  }
  return result;
}

QRVUserIdentityRef QRVUserIdentityCache::userIdentityForCurrentContext() {
  return userIdentityForCurrentContextWithUID(options_.mobileUID, options_.mobileGID);
}

QRVUserIdentityRef QRVUserIdentityCache::userIdentityForLegacyMobileUser() {
  return userIdentityForPersonalPersonaWithUID(options_.mobileUID, options_.mobileGID);
}

QRVUserIdentityRef QRVUserIdentityCache::userIdentityWithPersonaID(int32_t personaID) {
  QRVMutexLock lock(&mutex_);
  _lock_resyncIfNeeded();
  auto it = personaIDToUserIdentityMap_.find(personaID);
  return it == personaIDToUserIdentityMap_.end() ? nullptr : it->second;
}

QRVUserIdentityRef QRVUserIdentityCache::userIdentityForPersonalPersonaWithUID(uid_t uid, gid_t gid) {
  applyUIDFloor(&uid, &gid);
  QRVUserIdentityRef personal = userIdentityForPersonalPersona();
  return personal ? personal->withUID(uid, gid) : nullptr;
}

QRVUserIdentityRef QRVUserIdentityCache::userIdentityForPersonalPersona() {
  QRVMutexLock lock(&mutex_);
  _lock_resyncIfNeeded();
  return userIdentityForPersonalPersona_;
}

QRVUserIdentityRef QRVUserIdentityCache::unspecificUserIdentity() {
  QRVMutexLock lock(&mutex_);
  _lock_resyncIfNeeded();
  return userIdentityForUnspecificPersona_;
}

QRVUserIdentityRef QRVUserIdentityCache::userIdentityForPersonaUniqueString(const std::string& uniqueString,
                                                                           uid_t uid, gid_t gid) {
  applyUIDFloor(&uid, &gid);
  QRVUserIdentityRef known;
  {
    QRVMutexLock lock(&mutex_);
    _lock_resyncIfNeeded();
    auto it = personaUniqueStringToUserIdentityMap_.find(uniqueString);
    if (it != personaUniqueStringToUserIdentityMap_.end()) known = it->second;
  }
  return known ? known->withUID(uid, gid) : nullptr;
}

QRVUserIdentityRef QRVUserIdentityCache::userIdentityForCurrentUserWithPersonaUniqueString(
    const std::string& uniqueString) {
  return userIdentityForPersonaUniqueString(uniqueString, options_.mobileUID, options_.mobileGID);
}

std::vector<QRVUserIdentityRef> QRVUserIdentityCache::userIdentitiesForBundleIdentifier(
    const std::string& bundleIdentifier) {
  QRVMutexLock lock(&mutex_);
  _lock_resyncIfNeeded();
  auto it = bundleToEnterpriseIdentitiesMap_.find(bundleIdentifier);
  return it == bundleToEnterpriseIdentitiesMap_.end() ? std::vector<QRVUserIdentityRef>() : it->second;
}

bool QRVUserIdentityCache::isBundleIdentifier(const std::string& bundleIdentifier,
                                              const QRVUserIdentityRef& userIdentity) {
  if (!userIdentity) return false;
  for (const auto& u : userIdentitiesForBundleIdentifier(bundleIdentifier))
    if (u->isEqualToUserIdentity(*userIdentity)) return true;
  return false;
}

void QRVUserIdentityCache::forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
    const std::function<void(const QRVUserIdentityRef&)>& block) {
  std::vector<QRVUserIdentityRef> all;
  {
    QRVMutexLock lock(&mutex_);
    _lock_resyncIfNeeded();
    if (userIdentityForPersonalPersona_) all.push_back(userIdentityForPersonalPersona_);
    // Not a structured binding: clang before 16 cannot capture one.
    for (const auto& entry : personaIDToUserIdentityMap_) {
      const QRVUserIdentityRef& u = entry.second;
      bool seen = std::any_of(all.begin(), all.end(), [&](const QRVUserIdentityRef& a) {
        return a->isEqualToUserIdentity(*u);
      });
      if (!seen) all.push_back(u);
    }
    if (all.empty())
      QRVLogError("Expected to find at least one persona; self = {}, personaAttributeList = {}",
                  static_cast<const void*>(this), describePersonas(lastPersonas_));
  }
  // Outside the lock: the block may well ask the cache again.
  for (const auto& u : all) block(u);
}
