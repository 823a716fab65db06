#include "platform/linux/QRVLinuxFeatureFlags.h"

#include <fstream>
#include <iterator>
#include <vector>

#include "base/QRVPlist.h"

bool QRVLinuxFeatureFlags::isEnabled(const std::string& domain, const std::string& feature) {
  std::ifstream in(path_, std::ios::binary);
  if (!in) return false;
  std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  auto plist = QRVPlist::fromBytes(bytes.data(), bytes.size());
  if (!plist) return false;
  const QRVPlist* d = plist->get(domain);
  return d && d->boolForKey(feature);
}
