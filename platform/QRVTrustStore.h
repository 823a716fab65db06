// The platform security service: who a peer process is (its signing
// identifier) and what it may do (its entitlements), keyed by audit token.
#pragma once

#include <optional>
#include <string>

#include "base/QRVError.h"
#include "base/QRVPlist.h"
#include "platform/QRVAuditToken.h"

class QRVTrustStore {
 public:
  virtual ~QRVTrustStore() = default;

  // The signing identifier of the process behind `token`; fails when the
  // process is gone or has none.
  virtual std::optional<std::string> signingIdentifierForAuditToken(const QRVAuditToken& token,
                                                                    QRVError* error) = 0;
  // The process's entitlements dictionary, or none when it has none.
  virtual std::optional<QRVPlist> entitlementsForAuditToken(const QRVAuditToken& token) = 0;
};
