// A user identity: a user account, optionally narrowed to one of its
// personas. Containers of per-user classes belong to one.
//
// Immutable and shared by reference. Identities compare and hash by their
// identifier alone: the persona unique string for an enterprise persona, the
// uid in decimal otherwise. So two personal identities of one uid are equal
// whatever their group, home or persona string, and an enterprise identity
// equals no personal one.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <string>

#include "base/QRVError.h"
#include "base/QRVPlist.h"
#include "model/QRVContainerClass.h"

class QRVUserIdentityCache;

enum : uint32_t {
  QRVPersonaTypePersonal = 0,
  QRVPersonaTypeEnterprise = 1,
  QRVPersonaTypeNoSpecificPersona = 2,
};

class QRVUserIdentity;
using QRVUserIdentityRef = std::shared_ptr<const QRVUserIdentity>;

class QRVUserIdentity {
 public:
  // Accounts below this uid (role users, root) never own per-user
  // containers.
  static constexpr uid_t kMinimumUID = 501;

  // Null (and an error-level log) for a uid below 501.
  static QRVUserIdentityRef make(uid_t uid, gid_t gid, std::string homeDirectory, std::string personaUniqueString,
                                 uint32_t personaType, int32_t kernelPersonaID);
  // The default identity: uid and gid 501, personal, kernel persona 501, with
  // the given home (the home of uid 501).
  static QRVUserIdentityRef makeDefault(std::string homeDirectory);

  // Reads the property-list form, resolving the stored numbers through
  // `cache`. A value that is not a dictionary, or whose "version" is not the
  // string "1" or "2", yields an identity with every field unset and no
  // error; malformed fields fail with 75; an identity the cache cannot
  // supply fails with 1.
  static QRVUserIdentityRef userIdentityWithPlist(const QRVPlist& plist, QRVUserIdentityCache& cache, QRVError* error);
  // The version-2 form.
  QRVPlist plist() const;

  static std::string _identifierForPOSIXUID(uid_t uid, const std::string& personaUniqueString, uint32_t personaType);
  // False for bundle and system classes, true for every other number
  // (including the invalid ones).
  static bool isUserIdentityRequiredForContainerClass(QRVContainerClass c);

  const std::string& homeDirectoryURL() const { return homeDirectory_; }
  int32_t kernelPersonaID() const { return kernelPersonaID_; }
  uid_t posixUID() const { return uid_; }
  gid_t posixGID() const { return gid_; }
  uint32_t personaType() const { return personaType_; }
  const std::string& personaUniqueString() const { return personaUniqueString_; }
  const std::string& identifier() const { return identifier_; }

  // Owners of a class's directories: the installer account for bundle
  // classes, the system account for system classes, this user otherwise.
  uid_t posixUIDForContainerClass(QRVContainerClass c) const;
  gid_t posixGIDForContainerClass(QRVContainerClass c) const;

  bool isEnterprise() const { return personaType_ == QRVPersonaTypeEnterprise; }
  bool isNoSpecificPersona() const { return personaType_ == QRVPersonaTypeNoSpecificPersona; }
  bool isHomeDirectoryInCommonSandbox() const {
    return personaType_ == QRVPersonaTypePersonal || personaType_ == QRVPersonaTypeNoSpecificPersona;
  }

  // A copy with other ids (same persona).
  QRVUserIdentityRef withUID(uid_t uid, gid_t gid) const;

  bool isEqualToUserIdentity(const QRVUserIdentity& other) const { return identifier_ == other.identifier_; }
  size_t hash() const { return std::hash<std::string>()(identifier_); }

  std::string description() const;
  std::string shortDescription() const;

 private:
  QRVUserIdentity() = default;
  static QRVUserIdentityRef unset();
  static QRVUserIdentityRef fromVersion1(const QRVPlist& plist, QRVUserIdentityCache& cache, QRVError* error);
  static QRVUserIdentityRef fromVersion2(const QRVPlist& plist, QRVUserIdentityCache& cache, QRVError* error);

  std::string homeDirectory_;
  int32_t kernelPersonaID_ = 0;
  uid_t uid_ = 0;
  gid_t gid_ = 0;
  uint32_t personaType_ = 0;
  std::string personaUniqueString_;
  std::string identifier_;
};

// For maps keyed by identity.
struct QRVUserIdentityHash {
  size_t operator()(const QRVUserIdentityRef& u) const { return u ? u->hash() : 0; }
};
struct QRVUserIdentityEqual {
  bool operator()(const QRVUserIdentityRef& a, const QRVUserIdentityRef& b) const {
    return a == b || (a && b && a->isEqualToUserIdentity(*b));
  }
};

const char* QRVPersonaTypeDescription(uint32_t type);
