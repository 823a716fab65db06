// Personas from a property list (<root>/etc/quorva/personas.plist): an array
// of dictionaries with "PersonaID", "UID", "GID", "Type" (0 personal,
// 1 enterprise, others no specific persona), "UniqueString", "Home" (a path
// inside the root), "BundleIdentifiers", "Universal" and "System". Without
// the file the device has no personas. The file is watched with inotify; a
// change calls the observer. The host's multi-user flags come from
// <root>/etc/quorva/host.plist ("MultiUserFlags").
#pragma once

#include <string>

#include "base/QRVPlist.h"
#include "platform/QRVPersonaService.h"
#include "platform/linux/QRVFileWatcher.h"

class QRVLinuxPersonaService : public QRVPersonaService {
 public:
  QRVLinuxPersonaService(std::string personasPath, std::string hostPath);

  bool personasSupported() override;
  std::vector<QRVPersona> personas() override;
  std::optional<QRVPersona> personaForID(uint32_t personaID) override;
  void observe(std::function<void()> onChange) override;
  uint64_t multiUserFlags() override;

  // Reads a persona list; entries without a uid are skipped.
  static std::vector<QRVPersona> parse(const QRVPlist& list);

 private:
  const std::string personasPath_;
  const std::string hostPath_;
  QRVFileWatcher watcher_;
};
