#include "platform/linux/QRVLinuxAccounts.h"

#include <grp.h>
#include <pwd.h>

#include <cstdio>
#include <cstring>

#include "base/QRVMutex.h"

// fgetpwent/fgetgrent keep their result in static storage; look-ups are
// serialised so that concurrent callers cannot see each other's entries.
static QRVMutex gAccountsMutex;

template <typename Pred>
std::optional<QRVAccount> QRVLinuxAccounts::findAccount(Pred pred) {
  QRVMutexLock lock(&gAccountsMutex);
  FILE* f = fopen(passwdPath_.c_str(), "re");
  if (!f) return std::nullopt;
  std::optional<QRVAccount> found;
  while (passwd* pw = fgetpwent(f)) {
    if (pred(pw)) {
      found = QRVAccount{pw->pw_name, pw->pw_uid, pw->pw_gid, pw->pw_dir ? pw->pw_dir : ""};
      break;
    }
  }
  fclose(f);
  return found;
}

std::optional<QRVAccount> QRVLinuxAccounts::accountForName(const std::string& name) {
  return findAccount([&](passwd* pw) { return name == pw->pw_name; });
}

std::optional<QRVAccount> QRVLinuxAccounts::accountForUID(uid_t uid) {
  return findAccount([&](passwd* pw) { return pw->pw_uid == uid; });
}

std::optional<gid_t> QRVLinuxAccounts::groupIDForName(const std::string& name) {
  QRVMutexLock lock(&gAccountsMutex);
  FILE* f = fopen(groupPath_.c_str(), "re");
  if (!f) return std::nullopt;
  std::optional<gid_t> found;
  while (group* gr = fgetgrent(f)) {
    if (name == gr->gr_name) {
      found = gr->gr_gid;
      break;
    }
  }
  fclose(f);
  return found;
}
