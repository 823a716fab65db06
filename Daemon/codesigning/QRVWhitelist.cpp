#include "codesigning/QRVWhitelist.h"

#include <charconv>

#include "base/QRVLog.h"
#include "model/QRVContainerClass.h"

namespace {

// Deeper nesting than the table's two levels means nothing to a look-up;
// the bound only keeps a hostile table from exhausting the stack.
constexpr int kMaxNestingDepth = 16;

// The class a key of the whitelisted-container or code-sign mapping names:
// a decimal number 0 to 13 written without sign or leading zeros.
std::optional<uint64_t> classForKey(const std::string& key) {
  uint64_t value = 0;
  auto [end, ec] = std::from_chars(key.data(), key.data() + key.size(), value);
  if (ec != std::errc() || end != key.data() + key.size() || key.empty()) return std::nullopt;
  if (std::to_string(value) != key || value >= QRVContainerClassMax) return std::nullopt;
  return value;
}

bool isPlainComponent(const std::string& name) {
  return !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos &&
         name.find('\0') == std::string::npos;
}

QRVPlist::Array strings(std::initializer_list<const char*> identifiers) {
  QRVPlist::Array out;
  for (const char* identifier : identifiers) out.push_back(QRVPlist::string(identifier));
  return out;
}

// A well-known container lives in a directory named after its identifier.
QRVPlist namedAfterThemselves(std::initializer_list<const char*> identifiers) {
  QRVPlist mapping = QRVPlist::dictionary();
  for (const char* identifier : identifiers) mapping.set(identifier, QRVPlist::string(identifier));
  return mapping;
}

// The built-in rows; docs/well-known-containers.md gives the reason for each.
QRVWhitelist makeBuiltInWhitelist(bool isInternalImage) {
  QRVPlist systemContainers = namedAfterThemselves({
      "com.kelva.verdaned",
      "com.kelva.backupd",
      "com.kelva.boxlauncher",
      "com.kelva.diagnosticd",
      "com.kelva.settingsd",
      "com.kelva.fontservicesd",
      "com.kelva.networkd",
      "com.kelva.accountsd",
      "com.kelva.mediaindexd",
  });
  QRVPlist systemGroups = namedAfterThemselves({
      QRVWhitelist::kSharedSystemGroupIdentifier,
      "systemgroup.com.kelva.configurationprofiles",
      "systemgroup.com.kelva.diagnostics",
      "systemgroup.com.kelva.backup.state",
      "systemgroup.com.kelva.settings.shared",
      "systemgroup.com.kelva.networkextension",
      "systemgroup.com.kelva.mediaindex.thumbnails",
      "systemgroup.com.kelva.accounts.shared",
  });
  if (isInternalImage)
    systemGroups.set("systemgroup.com.kelva.quorva.internal",
                     QRVPlist::string("systemgroup.com.kelva.quorva.internal"));

  QRVPlist everybody = QRVPlist::dictionary()
                           .set("12", QRVPlist::array(strings({"com.kelva.fontservicesd"})))
                           .set("13", QRVPlist::array(strings({QRVWhitelist::kSharedSystemGroupIdentifier,
                                                               "systemgroup.com.kelva.configurationprofiles"})));

  const QRVPlist any;  // none: no restriction at this level
  QRVPlist clients = QRVPlist::dictionary();
  clients.set("com.kelva.verdaned", any);
  clients.set("com.kelva.backupd", QRVPlist::dictionary().set("2", any).set("7", any).set("12", any).set("13", any));
  clients.set("com.kelva.boxlauncher", QRVPlist::dictionary().set("1", any).set("2", any).set("3", any).set("7", any));
  clients.set("com.kelva.diagnosticd", QRVPlist::dictionary()
                                           .set("12", QRVPlist::array(strings({"com.kelva.crashreporterd"})))
                                           .set("13", QRVPlist::array(strings({"systemgroup.com.kelva.diagnostics"}))));
  clients.set("com.kelva.crashreporterd",
              QRVPlist::dictionary()
                  .set("12", QRVPlist::array(strings({"com.kelva.diagnosticd"})))
                  .set("13", QRVPlist::array(strings({"systemgroup.com.kelva.diagnostics"}))));
  clients.set("com.kelva.settingsd", QRVPlist::dictionary().set("2", any).set(
                                         "13", QRVPlist::array(strings({"systemgroup.com.kelva.settings.shared"}))));
  clients.set("com.kelva.mdmd", QRVPlist::dictionary().set("13", QRVPlist::array(strings({
                                                                     "systemgroup.com.kelva.configurationprofiles",
                                                                     "systemgroup.com.kelva.settings.shared",
                                                                 }))));
  clients.set("com.kelva.storaged", QRVPlist::dictionary().set("2", any).set("4", any).set("7", any));
  clients.set("com.kelva.mediaindexd",
              QRVPlist::dictionary().set("2", any).set(
                  "13", QRVPlist::array(strings({"systemgroup.com.kelva.mediaindex.thumbnails"}))));
  clients.set("com.kelva.vpnagentd", QRVPlist::dictionary().set("6", any).set(
                                         "13", QRVPlist::array(strings({"systemgroup.com.kelva.networkextension"}))));
  return QRVWhitelist(systemContainers, systemGroups, everybody, clients);
}

}  // namespace

QRVWhitelist::QRVWhitelist(const QRVPlist& systemContainerMapping, const QRVPlist& systemGroupContainerMapping,
                           const QRVPlist& whitelistedContainerMapping,
                           const QRVPlist& whitelistedCodeSignIdentifierMapping)
    : systemWhitelist_(_directoryNames(systemContainerMapping, "system container")),
      systemGroupWhitelist_(_directoryNames(systemGroupContainerMapping, "system group container")),
      whitelistedContainers_(QRVContainerClassMax),
      whitelistedCodeSignIdentifiers_(_convertArraysToSetsInNestedDictionary(whitelistedCodeSignIdentifierMapping, 0)) {
  for (const auto& [key, identifiers] : whitelistedContainerMapping.dictionaryValue()) {
    std::optional<uint64_t> containerClass = classForKey(key);
    if (!containerClass) {
      QRVLogError("Ignoring whitelisted containers of unknown class {}", key);
      continue;
    }
    Node converted = _convertArraysToSetsInNestedDictionary(identifiers, 1);
    if (converted.kind == Node::Kind::kSet) whitelistedContainers_[*containerClass] = std::move(converted.set);
  }
}

const QRVWhitelist& QRVWhitelist::sharedWhitelist(bool isInternalImage) {
  // Built on first use and never destroyed: daemon threads may still ask
  // while the process exits.
  static const QRVWhitelist* const external = new QRVWhitelist(makeBuiltInWhitelist(false));
  static const QRVWhitelist* const internal = new QRVWhitelist(makeBuiltInWhitelist(true));
  return isInternalImage ? *internal : *external;
}

QRVWhitelist::Node QRVWhitelist::_convertArraysToSetsInNestedDictionary(const QRVPlist& value, int depth) {
  Node node;
  if (depth > kMaxNestingDepth) return node;
  switch (value.type()) {
    case QRVPlist::Type::None:
      node.kind = Node::Kind::kNone;
      break;
    case QRVPlist::Type::Array:
      // Only strings can equal an identifier; a set holding anything else
      // (a nested list, a number) would never match, so those are left out.
      node.kind = Node::Kind::kSet;
      for (const QRVPlist& element : value.arrayValue())
        if (element.isString()) node.set.insert(element.stringValue());
      break;
    case QRVPlist::Type::Dictionary:
      node.kind = Node::Kind::kDictionary;
      for (const auto& [key, child] : value.dictionaryValue())
        node.dictionary.emplace(key, _convertArraysToSetsInNestedDictionary(child, depth + 1));
      break;
    default:
      break;
  }
  return node;
}

std::map<std::string, std::string, std::less<>> QRVWhitelist::_directoryNames(const QRVPlist& mapping,
                                                                              const char* what) {
  std::map<std::string, std::string, std::less<>> names;
  for (const auto& [identifier, value] : mapping.dictionaryValue()) {
    if (!value.isString() || !isPlainComponent(value.stringValue())) {
      QRVLogError("Ignoring well-known {} {} with directory name {}", what, identifier, value.description());
      continue;
    }
    names.emplace(identifier, value.stringValue());
  }
  return names;
}

std::vector<std::string> QRVWhitelist::_keys(const std::map<std::string, std::string, std::less<>>& mapping) {
  std::vector<std::string> keys;
  keys.reserve(mapping.size());
  for (const auto& entry : mapping) keys.push_back(entry.first);
  return keys;
}

std::vector<std::string> QRVWhitelist::wellknownSystemContainers() const { return _keys(systemWhitelist_); }

std::vector<std::string> QRVWhitelist::wellknownSystemGroupContainers() const { return _keys(systemGroupWhitelist_); }

bool QRVWhitelist::systemContainerIdIsWellknown(const std::string& identifier) {
  return systemWhitelist_.count(identifier) != 0;
}

bool QRVWhitelist::systemGroupContainerIdIsWellknown(const std::string& identifier) {
  return systemGroupWhitelist_.count(identifier) != 0;
}

std::optional<std::string> QRVWhitelist::wellknownSystemContainerForId(const std::string& identifier) {
  auto it = systemWhitelist_.find(identifier);
  return it == systemWhitelist_.end() ? std::nullopt : std::optional<std::string>(it->second);
}

std::optional<std::string> QRVWhitelist::wellknownSystemGroupContainerForId(const std::string& identifier) {
  auto it = systemGroupWhitelist_.find(identifier);
  return it == systemGroupWhitelist_.end() ? std::nullopt : std::optional<std::string>(it->second);
}

bool QRVWhitelist::containerIdIsWellknown(const std::string& identifier, uint64_t containerClass) {
  if (containerClass == QRVContainerClassSystemData) return systemContainerIdIsWellknown(identifier);
  if (containerClass == QRVContainerClassSystemGroup) return systemGroupContainerIdIsWellknown(identifier);
  return false;
}

std::optional<std::string> QRVWhitelist::wellknownContainerForId(const std::string& identifier,
                                                                 uint64_t containerClass) {
  if (containerClass == QRVContainerClassSystemData) return wellknownSystemContainerForId(identifier);
  if (containerClass == QRVContainerClassSystemGroup) return wellknownSystemGroupContainerForId(identifier);
  return std::nullopt;
}

bool QRVWhitelist::isLookupWhitelistedFromCodeSignIdentifier(const std::string& codeSignIdentifier,
                                                             uint64_t containerClass,
                                                             const std::string& containerIdentifier) {
  if (containerClass >= QRVContainerClassMax) return false;
  const auto& everybody = whitelistedContainers_[containerClass];
  if (everybody && everybody->count(containerIdentifier)) return true;

  auto client = whitelistedCodeSignIdentifiers_.dictionary.find(codeSignIdentifier);
  if (client == whitelistedCodeSignIdentifiers_.dictionary.end()) return false;
  if (client->second.kind == Node::Kind::kNone) return true;
  auto classEntry = client->second.dictionary.find(std::to_string(containerClass));
  if (classEntry == client->second.dictionary.end()) return false;
  if (classEntry->second.kind == Node::Kind::kNone) return true;
  return classEntry->second.kind == Node::Kind::kSet && classEntry->second.set.count(containerIdentifier) != 0;
}
