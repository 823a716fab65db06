#include "model/QRVUserIdentity.h"

#include "base/QRVLog.h"
#include "users/QRVUserIdentityCache.h"

const char* QRVPersonaTypeDescription(uint32_t type) {
  switch (type) {
    case QRVPersonaTypePersonal: return "personal";
    case QRVPersonaTypeEnterprise: return "enterprise";
    case QRVPersonaTypeNoSpecificPersona: return "unspecific";
    default: return "unknown";
  }
}

QRVUserIdentityRef QRVUserIdentity::make(uid_t uid, gid_t gid, std::string homeDirectory,
                                         std::string personaUniqueString, uint32_t personaType,
                                         int32_t kernelPersonaID) {
  if (uid < kMinimumUID) {
    QRVLogError("Attempt to create a QRVUserIdentity object with a role user uid is not allowed: uid = {}, gid = {}",
                uid, gid);
    return nullptr;
  }
  if (homeDirectory.empty()) QRVLogError("Home directory cannot be nil");
  auto u = std::shared_ptr<QRVUserIdentity>(new QRVUserIdentity());
  u->uid_ = uid;
  u->gid_ = gid;
  u->personaUniqueString_ = std::move(personaUniqueString);
  u->personaType_ = personaType;
  u->identifier_ = _identifierForPOSIXUID(uid, u->personaUniqueString_, personaType);
  u->homeDirectory_ = std::move(homeDirectory);
  u->kernelPersonaID_ = kernelPersonaID;
  return u;
}

QRVUserIdentityRef QRVUserIdentity::makeDefault(std::string homeDirectory) {
  return make(kMinimumUID, kMinimumUID, std::move(homeDirectory), "", QRVPersonaTypePersonal,
              static_cast<int32_t>(kMinimumUID));
}

QRVUserIdentityRef QRVUserIdentity::unset() { return std::shared_ptr<QRVUserIdentity>(new QRVUserIdentity()); }

QRVUserIdentityRef QRVUserIdentity::withUID(uid_t uid, gid_t gid) const {
  return make(uid, gid, homeDirectory_, personaUniqueString_, personaType_, kernelPersonaID_);
}

std::string QRVUserIdentity::_identifierForPOSIXUID(uid_t uid, const std::string& personaUniqueString,
                                                    uint32_t personaType) {
  if (personaType == QRVPersonaTypeEnterprise && !personaUniqueString.empty()) return personaUniqueString;
  return std::to_string(uid);
}

bool QRVUserIdentity::isUserIdentityRequiredForContainerClass(QRVContainerClass c) {
  return !QRVContainerClassIsBundle(c) && !QRVContainerClassIsSystem(c);
}

uid_t QRVUserIdentity::posixUIDForContainerClass(QRVContainerClass c) const {
  if (QRVContainerClassIsBundle(c)) return CONTAINER_INSTALLATION_UID;
  if (QRVContainerClassIsSystem(c)) return CONTAINER_SYSTEM_UID;
  return uid_;
}

gid_t QRVUserIdentity::posixGIDForContainerClass(QRVContainerClass c) const {
  // The group of bundle and system directories is the owning account's uid,
  // on purpose.
  if (QRVContainerClassIsBundle(c)) return CONTAINER_INSTALLATION_UID;
  if (QRVContainerClassIsSystem(c)) return CONTAINER_SYSTEM_UID;
  return gid_;
}

namespace {

const char* typeName(const QRVPlist* v) {
  if (!v) return "(null)";
  switch (v->type()) {
    case QRVPlist::Type::None: return "(null)";
    case QRVPlist::Type::Boolean: return "boolean";
    case QRVPlist::Type::UInteger: return "integer";
    case QRVPlist::Type::Real: return "real";
    case QRVPlist::Type::String: return "string";
    case QRVPlist::Type::Data: return "data";
    case QRVPlist::Type::Date: return "date";
    case QRVPlist::Type::Array: return "array";
    case QRVPlist::Type::Dictionary: return "dictionary";
  }
  return "(null)";
}

// Reads a numeric field; on failure logs the plist error and returns false.
bool readNumber(const QRVPlist& plist, const char* key, uint64_t* out, QRVError* error) {
  const QRVPlist* v = plist.get(key);
  if (v && v->type() == QRVPlist::Type::UInteger) {
    *out = v->uint64Value();
    return true;
  }
  if (v && v->type() == QRVPlist::Type::Real && v->realValue() >= 0) {
    *out = static_cast<uint64_t>(v->realValue());
    return true;
  }
  return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidUserIdentityData,
                                  "Invalid user identity plist data. Expected number for {}, got {}. Data: {}", key,
                                  typeName(v), plist.description()));
}

}  // namespace

QRVUserIdentityRef QRVUserIdentity::userIdentityWithPlist(const QRVPlist& plist, QRVUserIdentityCache& cache,
                                                          QRVError* error) {
  const QRVPlist* version = plist.get("version");
  // Compared as strings: a number 2 is neither version.
  if (version && version->isString() && version->stringValue() == "2") return fromVersion2(plist, cache, error);
  if (version && version->isString() && version->stringValue() == "1") return fromVersion1(plist, cache, error);
  // Not an identity at all: an empty one, whose later validation fails.
  return unset();
}

QRVUserIdentityRef QRVUserIdentity::fromVersion2(const QRVPlist& plist, QRVUserIdentityCache& cache,
                                                 QRVError* error) {
  uint64_t uid = 0, gid = 0, type = 0;
  if (!readNumber(plist, "posixUID", &uid, error) || !readNumber(plist, "posixGID", &gid, error) ||
      !readNumber(plist, "type", &type, error))
    return nullptr;
  if (type >= 3) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidUserIdentityData,
                             "Invalid user identity plist data. Expected persona type for {}, got {}. Data: {}", "type",
                             type, plist.description()));
    return nullptr;
  }
  const QRVPlist* persona = plist.get("personaUniqueString");
  QRVUserIdentityRef identity;
  if (type == QRVPersonaTypeEnterprise && persona && persona->isString()) {
    identity = cache.userIdentityForPersonaUniqueString(persona->stringValue(), static_cast<uid_t>(uid),
                                                        static_cast<gid_t>(gid));
    if (!identity) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kSuccess, "No user identity for persona {}", persona->stringValue()));
      return nullptr;
    }
    if (!identity->isEnterprise())
      QRVLogError("Invalid user identity plist data. Expected {} to be enterprise, but it was not. Data: {}",
                  identity->description(), plist.description());
    return identity;
  }
  // A stored "unspecific" identity reads back as the personal one of its uid.
  identity = cache.userIdentityForPersonalPersonaWithUID(static_cast<uid_t>(uid), static_cast<gid_t>(gid));
  if (!identity) QRVFail(error, QRV_ERROR(QRVResultCode::kSuccess, "No personal user identity for uid {}", uid));
  return identity;
}

QRVUserIdentityRef QRVUserIdentity::fromVersion1(const QRVPlist& plist, QRVUserIdentityCache& cache,
                                                 QRVError* error) {
  uint64_t uid = 0, gid = 0;
  if (!readNumber(plist, "posixUID", &uid, error) || !readNumber(plist, "posixGID", &gid, error)) return nullptr;
  QRVUserIdentityRef identity;
  const QRVPlist* persona = plist.get("personaIdentifier");
  if (persona && persona->isString())
    identity = cache.userIdentityForPersonaUniqueString(persona->stringValue(), static_cast<uid_t>(uid),
                                                        static_cast<gid_t>(gid));
  if (!identity)
    identity = cache.userIdentityForPersonalPersonaWithUID(static_cast<uid_t>(uid), static_cast<gid_t>(gid));
  if (!identity) QRVFail(error, QRV_ERROR(QRVResultCode::kSuccess, "No personal user identity for uid {}", uid));
  return identity;
}

QRVPlist QRVUserIdentity::plist() const {
  QRVPlist p = QRVPlist::dictionary()
                   .set("posixUID", QRVPlist::uinteger(uid_))
                   .set("posixGID", QRVPlist::uinteger(gid_))
                   .set("type", QRVPlist::uinteger(personaType_))
                   .set("version", QRVPlist::string("2"));
  if (!personaUniqueString_.empty()) p.set("personaUniqueString", QRVPlist::string(personaUniqueString_));
  return p;
}

std::string QRVUserIdentity::description() const {
  return fmt::format(
      "<QRVUserIdentity: {}; posixUID = {}, posixGID = {}, identifier = {}, homeDirectoryURL = file://{}/, "
      "personaType = {}, personaUniqueString = {}, kernelPersonaID = {}>",
      static_cast<const void*>(this), uid_, gid_, identifier_, homeDirectory_, QRVPersonaTypeDescription(personaType_),
      personaUniqueString_.empty() ? "(null)" : personaUniqueString_, kernelPersonaID_);
}

std::string QRVUserIdentity::shortDescription() const {
  return fmt::format("<QRVUserIdentity: {}; {}/{}/{}/{}/{}>", static_cast<const void*>(this), uid_, gid_, identifier_,
                     personaType_, kernelPersonaID_);
}
