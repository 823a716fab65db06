#include "platform/linux/QRVLinuxFeatureFlags.h"

#include <fstream>
#include <iterator>
#include <vector>

bool QRVLinuxFeatureFlags::Version::operator==(const Version& other) const {
  return device == other.device && inode == other.inode && size == other.size &&
         modified.tv_sec == other.modified.tv_sec && modified.tv_nsec == other.modified.tv_nsec &&
         changed.tv_sec == other.changed.tv_sec && changed.tv_nsec == other.changed.tv_nsec;
}

bool QRVLinuxFeatureFlags::isEnabled(const std::string& domain, const std::string& feature) {
  Version now;
  struct stat st {};
  if (::stat(path_.c_str(), &st) == 0)
    now = {st.st_dev, st.st_ino, st.st_size, st.st_mtim, st.st_ctim};

  QRVMutexLock lock(&mutex_);
  if (!version_ || !(*version_ == now)) {
    // Read under the lock: the file is small, and only the questions asked
    // right after it changed wait for it. A change between the stat and the
    // read shows as a new version at the next question.
    flags_.reset();
    std::ifstream in(path_, std::ios::binary);
    if (in) {
      std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
      flags_ = QRVPlist::fromBytes(bytes.data(), bytes.size());
    }
    version_ = now;
  }
  const QRVPlist* d = flags_ ? flags_->get(domain) : nullptr;
  return d && d->boolForKey(feature);
}
