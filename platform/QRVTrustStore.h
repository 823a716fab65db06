// The platform security service: who a peer process is (its signing
// identifier) and what it may do (its entitlements), keyed by audit token.
#pragma once

#include <cstdint>
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
  // For a live process that no trust-store entry matches: the absolute path
  // of its executable as the kernel resolved it when the program started (no
  // links, no "." or ".." components), so that the daemon can recognise
  // programs that run from its bundle containers. None when the process is
  // gone or the token no longer describes it, when an entry matches it, or
  // when the path no longer names the file being run (deleted or replaced
  // since). By default no executable is known.
  virtual std::optional<std::string> executablePathForUnlistedAuditToken(const QRVAuditToken& token) {
    return std::nullopt;
  }
  // A number that changes whenever the store's own entries change, so that
  // an answer given for a peer whose QRVPeerProcessState has not changed
  // since may be kept while it stays the same. None when the store cannot
  // tell: every answer must then be asked for anew. Cheap (at most one
  // system call) and safe on any thread.
  virtual std::optional<uint64_t> changeCount() { return std::nullopt; }
};
