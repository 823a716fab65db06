// A marker that lives until the operating system restarts: present means the
// boot work of the current boot has been completed.
#pragma once

#include <string>

class QRVFirstBootMarker {
 public:
  virtual ~QRVFirstBootMarker() = default;
  virtual const std::string& name() const = 0;
  // True when the marker exists (this is not the first start since boot).
  virtual bool exists() = 0;
  // Creates the marker. On failure returns false and stores the errno.
  virtual bool create(int* errnum) = 0;
};
