// Who sent a request: the immutable record of a calling process, built anew
// for every message from the connection's credentials and the trust store.
//
// The daemon's own work uses a privileged identity that it makes for itself.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>

#include "QRVAuditToken.h"
#include "QRVMessageService.h"
#include "QRVPlist.h"
#include "QRVServices.h"

class QRVClientIdentity {
 public:
  QRVClientIdentity(std::string bundleIdentifier, uid_t uid, gid_t gid, pid_t pid, QRVPlist entitlements,
                    bool sandboxed, QRVAuditToken auditToken);

  // The identity of the peer of `connection`, or null when the peer's
  // signing identifier cannot be read (it then holds no powers).
  static std::shared_ptr<const QRVClientIdentity> clientIdentityWithRelayConnection(
      const QRVConnection& connection, QRVServices& services);
  // The daemon itself: "com.kelva.quorvad.internal", ids 0, no
  // entitlements, not sandboxed, an all-zero audit token.
  static std::shared_ptr<const QRVClientIdentity> anonymousPrivilegedClientIdentity();

  const std::string& bundleIdentifier() const { return bundleIdentifier_; }
  uid_t posixUID() const { return uid_; }
  gid_t posixGID() const { return gid_; }
  pid_t posixPID() const { return pid_; }
  const QRVPlist& entitlements() const { return entitlements_; }
  bool isSandboxed() const { return sandboxed_; }
  const QRVAuditToken& auditToken() const { return auditToken_; }

  // The named entitlement read as a boolean: true only for a true boolean or
  // a non-zero number.
  bool boolValueOfEntitlement(const std::string& name) const;
  // The raw value of the named entitlement, or null.
  const QRVPlist* valueOfEntitlement(const std::string& name) const { return entitlements_.get(name); }

  std::string description() const;

 private:
  const std::string bundleIdentifier_;
  const uid_t uid_;
  const gid_t gid_;
  const pid_t pid_;
  const QRVPlist entitlements_;
  const bool sandboxed_;
  const QRVAuditToken auditToken_;
};
