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

// The kernel's persona types as the upcall sees them. The persona list speaks
// of the user identity's types instead (0 personal, 1 enterprise, anything
// else no specific persona); an enterprise persona is the kernel's managed
// persona and the personal one its default persona, the two kinds that have
// a user identity of their own. Every other persona is a guest of the
// device's personal user.
enum : uint32_t {
  QRVKernelPersonaTypeGuest = 1,
  QRVKernelPersonaTypeManaged = 2,
  QRVKernelPersonaTypeDefault = 5,
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
  // The bit of multiUserFlags() that makes the host multi-user: every uid
  // is then a user of its own.
  static constexpr uint64_t kMultiUserHostBit = 0x80000000u;
  bool isMultiUserHost() { return (multiUserFlags() & kMultiUserHostBit) != 0; }

  // The kernel's type of persona `personaID`, or none when there is no such
  // persona.
  virtual std::optional<uint32_t> kernelPersonaType(uint32_t personaID) {
    std::optional<QRVPersona> persona = personaForID(personaID);
    if (!persona) return std::nullopt;
    switch (persona->type) {
      case 0:
        return QRVKernelPersonaTypeDefault;
      case 1:
        return QRVKernelPersonaTypeManaged;
      default:
        return QRVKernelPersonaTypeGuest;
    }
  }
};
