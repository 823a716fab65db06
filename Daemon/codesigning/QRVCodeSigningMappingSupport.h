// What the code-signing mapping's source files share: how an entry's
// entitlements and claims are read. Internal to the mapping.
#pragma once

#include <optional>

#include "base/QRVError.h"
#include "base/QRVPlist.h"
#include "base/QRVResultCode.h"
#include "codesigning/QRVCodeSigningEntry.h"
#include "codesigning/QRVCodeSigningMapping.h"

namespace QRVCodeSigningMappingSupport {

// Where an application's code-signing information was kept before the
// database: in its bundle container's info values.
inline constexpr const char* kCachedCodeSigningInfoKey = "com.kelva.Verdane.CachedCodeSigningInfo";
inline constexpr const char* kCachedEntitlementsKey = "Entitlements";

inline bool isNotFound(const QRVError& error) {
  return error.domain() == QRVError::kDomain && error.code() == QRVResultCode::kDatabaseNotFound;
}

// The entitlements inside a code-signing dictionary; none when the
// dictionary is absent or holds no entitlements dictionary.
inline std::optional<QRVPlist> entitlementsFromInfo(const QRVPlist& info) {
  if (!info.isDictionary()) return std::nullopt;
  const QRVPlist* entitlements = info.get(kQRVCodeSigningEntitlementsKey);
  if (!entitlements || !entitlements->isDictionary()) return std::nullopt;
  return *entitlements;
}

// The code-signing dictionary as a reader may see it: an external requester
// is not shown what is not (or no longer) installed.
inline const QRVPlist* codeSigningInfoForEntry(const QRVCodeSigningEntry* entry, bool externalRequest) {
  if (!entry || !entry->hasCodeSigningInfo()) return nullptr;
  if (externalRequest && (entry->isPlaceholder() || entry->isAdvanceCopy() || entry->isInvalid())) return nullptr;
  return &entry->codeSigningInfo();
}

inline std::optional<QRVPlist> entitlementsFromEntry(const QRVCodeSigningEntry* entry) {
  const QRVPlist* info = codeSigningInfoForEntry(entry, /*externalRequest=*/false);
  return info ? entitlementsFromInfo(*info) : std::nullopt;
}

// Only a boolean true grants a system container.
inline bool claimsSystemContainer(const std::optional<QRVPlist>& entitlements) {
  if (!entitlements) return false;
  const QRVPlist* value = entitlements->get(kQRVSystemContainerEntitlement);
  return value && value->type() == QRVPlist::Type::Boolean && value->boolValue();
}

}  // namespace QRVCodeSigningMappingSupport
