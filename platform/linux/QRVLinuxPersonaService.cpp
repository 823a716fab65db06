#include "platform/linux/QRVLinuxPersonaService.h"

#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "base/QRVLog.h"

namespace {

std::optional<QRVPlist> readPlist(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::nullopt;
  std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  return QRVPlist::fromBytes(bytes.data(), bytes.size());
}

}  // namespace

QRVLinuxPersonaService::QRVLinuxPersonaService(std::string personasPath, std::string hostPath)
    : personasPath_(std::move(personasPath)), hostPath_(std::move(hostPath)) {}

bool QRVLinuxPersonaService::personasSupported() {
  std::error_code ec;
  return std::filesystem::exists(personasPath_, ec);
}

std::vector<QRVPersona> QRVLinuxPersonaService::parse(const QRVPlist& list) {
  std::vector<QRVPersona> out;
  for (const QRVPlist& d : list.arrayValue()) {
    if (!d.get("UID")) continue;
    QRVPersona p;
    p.personaID = static_cast<uint32_t>(d.uint64ForKey("PersonaID"));
    p.uid = static_cast<uid_t>(d.uint64ForKey("UID"));
    p.gid = static_cast<gid_t>(d.get("GID") ? d.uint64ForKey("GID") : p.uid);
    p.type = static_cast<uint32_t>(d.uint64ForKey("Type"));
    p.uniqueString = d.stringForKey("UniqueString");
    p.home = d.stringForKey("Home");
    for (const QRVPlist& b : d.arrayForKey("BundleIdentifiers"))
      if (b.isString()) p.bundleIdentifiers.push_back(b.stringValue());
    p.isUniversal = d.boolForKey("Universal");
    p.isSystem = d.boolForKey("System");
    out.push_back(std::move(p));
  }
  return out;
}

std::vector<QRVPersona> QRVLinuxPersonaService::personas() {
  auto plist = readPlist(personasPath_);
  if (!plist || !plist->isArray()) {
    if (plist) QRVLogError("persona list {} is not an array", personasPath_);
    return {};
  }
  return parse(*plist);
}

std::optional<QRVPersona> QRVLinuxPersonaService::personaForID(uint32_t personaID) {
  for (QRVPersona& p : personas())
    if (p.personaID == personaID) return std::move(p);
  return std::nullopt;
}

void QRVLinuxPersonaService::observe(std::function<void()> onChange) {
  if (int e = watcher_.start(personasPath_, std::move(onChange)); e != 0)
    QRVLogError("Failed to register for persona list updates: {}", strerror(e));
}

uint64_t QRVLinuxPersonaService::multiUserFlags() {
  auto plist = readPlist(hostPath_);
  return plist ? plist->uint64ForKey("MultiUserFlags") : 0;
}
