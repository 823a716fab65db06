// User and group accounts.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

struct QRVAccount {
  std::string name;
  uid_t uid = 0;
  gid_t gid = 0;
  std::string home;  // as written in the account database (a path inside the root)
};

class QRVAccounts {
 public:
  virtual ~QRVAccounts() = default;
  virtual std::optional<QRVAccount> accountForName(const std::string& name) = 0;
  virtual std::optional<QRVAccount> accountForUID(uid_t uid) = 0;
  virtual std::optional<gid_t> groupIDForName(const std::string& name) = 0;
};
