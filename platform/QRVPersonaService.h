// The persona service: the list of personas (user contexts) of the device.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

struct QRVPersona {
  uint32_t personaID = 0;
  uid_t uid = 0;
  gid_t gid = 0;
  uint32_t type = 0;
  std::string uniqueString;
  std::string home;
  std::vector<std::string> bundleIdentifiers;
  bool isUniversal = false;
  bool isSystem = false;
};

class QRVPersonaService {
 public:
  virtual ~QRVPersonaService() = default;
  // False when the platform has no personas at all.
  virtual bool personasSupported() = 0;
  virtual std::vector<QRVPersona> personas() = 0;
  virtual std::optional<QRVPersona> personaForID(uint32_t personaID) = 0;
  // Called after every change of the list.
  virtual void observe(std::function<void()> onChange) = 0;
  virtual uint64_t multiUserFlags() = 0;
};
