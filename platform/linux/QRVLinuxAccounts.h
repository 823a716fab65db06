// Accounts from passwd and group files. On a device these are /etc/passwd
// and /etc/group; under a development root, the root's own copies, so that
// a root carries its own accounts. Files are read on each look-up (look-ups
// are rare: start-up and per-user set-up).
#pragma once

#include <string>

#include "platform/QRVAccounts.h"

class QRVLinuxAccounts : public QRVAccounts {
 public:
  QRVLinuxAccounts(std::string passwdPath, std::string groupPath)
      : passwdPath_(std::move(passwdPath)), groupPath_(std::move(groupPath)) {}
  std::optional<QRVAccount> accountForName(const std::string& name) override;
  std::optional<QRVAccount> accountForUID(uid_t uid) override;
  std::optional<gid_t> groupIDForName(const std::string& name) override;

 private:
  template <typename Pred>
  std::optional<QRVAccount> findAccount(Pred pred);

  const std::string passwdPath_;
  const std::string groupPath_;
};
