// Who sent a request: the immutable record of a calling process, built from
// the connection's credentials and the trust store, and built anew whenever
// anything it was built from may have changed (see QRVRelayPeer).
//
// The daemon's own work uses a privileged identity that it makes for itself.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>

#include "base/QRVPlist.h"
#include "core/QRVServices.h"
#include "model/QRVUserIdentity.h"
#include "platform/QRVAuditToken.h"
#include "platform/QRVMessageService.h"

class QRVClientIdentity {
 public:
  // The signing identifier of the platform installer, whose identity is
  // kept between its (many, bursty) requests while its process lives.
  static constexpr const char* kInstallerIdentifier = "com.kelva.verdaned";
  // The daemon acting for itself.
  static constexpr const char* kPrivilegedIdentifier = "com.kelva.quorvad.internal";

  QRVClientIdentity(std::string bundleIdentifier, uid_t uid, gid_t gid, pid_t pid, QRVUserIdentityRef userIdentity,
                    QRVPlist entitlements, bool sandboxed, QRVAuditToken auditToken);

  // The identity of the peer of `connection`, or null when the peer's
  // signing identifier cannot be read (it then holds no powers). With
  // `keepable`, says whether the identity follows from the peer's process
  // state, the trust store and the user identity alone (so that it may be
  // kept while those stay the same; see QRVRelayPeer): true for a peer the
  // trust store lists.
  static std::shared_ptr<const QRVClientIdentity> clientIdentityWithRelayConnection(
      const QRVConnection& connection, QRVServices& services, bool* keepable = nullptr);
  // The daemon itself acting for `userIdentity`: "com.kelva.quorvad.internal",
  // ids 0, no entitlements, not sandboxed, an all-zero audit token.
  static std::shared_ptr<const QRVClientIdentity> privilegedClientIdentityWithUserIdentity(
      QRVUserIdentityRef userIdentity);
  // The same for the cache's default user identity.
  static std::shared_ptr<const QRVClientIdentity> anonymousPrivilegedClientIdentity(QRVUserIdentityCache& cache);

  const std::string& bundleIdentifier() const { return bundleIdentifier_; }
  uid_t posixUID() const { return uid_; }
  gid_t posixGID() const { return gid_; }
  pid_t posixPID() const { return pid_; }
  const QRVUserIdentityRef& userIdentity() const { return userIdentity_; }
  const QRVPlist& entitlements() const { return entitlements_; }
  bool isSandboxed() const { return sandboxed_; }
  const QRVAuditToken& auditToken() const { return auditToken_; }

  // The named entitlement read as a boolean: true only for a true boolean or
  // a non-zero number.
  bool boolValueOfEntitlement(const std::string& name) const;
  // The raw value of the named entitlement, or null.
  const QRVPlist* valueOfEntitlement(const std::string& name) const { return entitlements_.get(name); }

  // Owners of containers of a class, as the user identity decides them.
  uid_t posixUIDForContainerClass(QRVContainerClass c) const { return userIdentity_->posixUIDForContainerClass(c); }
  gid_t posixGIDForContainerClass(QRVContainerClass c) const { return userIdentity_->posixGIDForContainerClass(c); }

  std::string description() const;

 private:
  const std::string bundleIdentifier_;
  const uid_t uid_;
  const gid_t gid_;
  const pid_t pid_;
  const QRVUserIdentityRef userIdentity_;
  const QRVPlist entitlements_;
  const bool sandboxed_;
  const QRVAuditToken auditToken_;
};
