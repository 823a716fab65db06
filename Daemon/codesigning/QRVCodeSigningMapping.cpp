#include "codesigning/QRVCodeSigningMapping.h"

#include <algorithm>
#include <exception>
#include <utility>

#include "base/QRVLog.h"
#include "base/QRVResultCode.h"
#include "codesigning/QRVCodeSigningMappingSupport.h"
#include "codesigning/QRVSQLiteDB.h"
#include "core/QRVCommandQueue.h"
#include "core/QRVCommandStageForDelete.h"
#include "core/QRVExceptionReporter.h"
#include "core/QRVServices.h"
#include "model/QRVContainerCache.h"
#include "model/QRVGlobalConfiguration.h"
#include "model/QRVPerUserConfiguration.h"
#include "users/QRVUserIdentityCache.h"

using namespace QRVCodeSigningMappingSupport;

namespace {

// "(a, b)" for a list, "(null)" for none: how the log lines show group lists.
std::string describeList(const std::optional<std::vector<std::string>>& list) {
  if (!list) return "(null)";
  std::string text = "(";
  for (size_t i = 0; i < list->size(); i++) {
    if (i) text += ", ";
    text += (*list)[i];
  }
  return text + ")";
}

std::string describeValue(const QRVPlist* value) { return value ? value->description() : "(null)"; }

// A group entitlement: an array of strings or one string. Anything else is
// refused whole, so that one malformed element cannot turn into a claim on
// some other group.
std::optional<std::vector<std::string>> copyGroupEntitlement(const std::string& identifier,
                                                             const std::optional<QRVPlist>& entitlements,
                                                             const char* groupKey) {
  if (!entitlements) return std::nullopt;
  const QRVPlist* value = entitlements->get(groupKey);
  if (!value) return std::nullopt;
  std::set<std::string> groups;
  if (value->isString()) {
    groups.insert(value->stringValue());
  } else if (value->isArray()) {
    for (const QRVPlist& element : value->arrayValue()) {
      if (!element.isString()) {
        QRVLogError("Entitlement {} for {} contains non-string values; ignoring.", groupKey, identifier);
        return std::nullopt;
      }
      groups.insert(element.stringValue());
    }
  } else {
    QRVLogError("Entitlement {} for {} does not contain supported types; ignoring.", groupKey, identifier);
    return std::nullopt;
  }
  return std::vector<std::string>(groups.begin(), groups.end());
}

// The system groups claimed, before the prefix rule: the system-groups
// entitlement, or the older system-group-containers one when the first is
// absent or empty.
std::optional<std::vector<std::string>> copySystemGroupEntitlement(const std::string& identifier,
                                                                   const std::optional<QRVPlist>& entitlements) {
  auto groups = copyGroupEntitlement(identifier, entitlements, kQRVSystemGroupsEntitlement);
  if (!groups || groups->empty()) {
    auto fallback = copyGroupEntitlement(identifier, entitlements, kQRVSystemGroupContainersEntitlement);
    if (fallback) return fallback;
  }
  return groups;
}

std::optional<std::vector<std::string>> systemGroupIdentifiers(const std::string& identifier,
                                                               const std::optional<QRVPlist>& entitlements) {
  auto groups = copySystemGroupEntitlement(identifier, entitlements);
  if (!groups) return std::nullopt;
  std::vector<std::string> kept;
  for (const std::string& group : *groups) {
    if (group.starts_with(kQRVSystemGroupPrefix)) {
      kept.push_back(group);
    } else {
      QRVLogError("System group ID {} does not have proper prefix, ignoring.", group);
    }
  }
  return kept;
}

}  // namespace

QRVCodeSigningMapping::QRVCodeSigningMapping(std::weak_ptr<QRVServices> services)
    : services_(std::move(services)), queue_(QRVSerialQueue::create("com.kelva.Quorva.EntitlementQueue")) {}

QRVCodeSigningMapping::~QRVCodeSigningMapping() = default;

// MARK: - The database

QRVSQLiteDB* QRVCodeSigningMapping::_onQueue_db() {
  if (db_) return db_.get();
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return nullptr;
  std::weak_ptr<QRVServices> weakServices = services_;
  // An exception inside a transaction is a bug: an internal build reports it
  // (which ends the daemon); a customer build rolls back and goes on.
  auto reporter = [weakServices](std::exception_ptr exception) {
    std::shared_ptr<QRVServices> s = weakServices.lock();
    if (s && s->globalConfiguration->isInternalImage()) QRVReportUncaughtException(exception);
  };
  QRVError error;
  db_ = QRVSQLiteDB::tryInitWithParentDirectoryURL(services->globalConfiguration->libraryDirectory(), &error,
                                                   std::move(reporter));
  if (!db_) {
    // Tried again at the next use: the file may be released or repaired.
    QRVLogError("Failed to initialize database.");
    return nullptr;
  }
  _onQueue_migrateFromMappingFileToDBIfNecessary(*db_);
  return db_.get();
}

std::shared_ptr<const QRVCodeSigningEntry> QRVCodeSigningMapping::_onQueue_entry(const std::string& identifier,
                                                                                 QRVError* error) {
  QRVSQLiteDB* db = _onQueue_db();
  if (!db) {
    QRVFail(error, QRV_ERROR_QUIET(QRVResultCode::kDatabaseNotFound, "Identifier: \"{}\" Not Found in DB", identifier));
    return nullptr;
  }
  return db->codeSigningEntryWithIdentifier(identifier, error);
}

std::optional<std::string> QRVCodeSigningMapping::_onQueue_parent(const std::string& childIdentifier) {
  QRVSQLiteDB* db = _onQueue_db();
  if (!db) return std::nullopt;
  QRVError error;
  std::optional<std::string> parent = db->parentIdentifierForChildIdentifier(childIdentifier, &error);
  if (!parent && !isNotFound(error))
    QRVLogError("Error retrieving child bundles ids from DB with identifier {} : {}", childIdentifier,
                error.description());
  return parent;
}

std::optional<std::vector<std::string>> QRVCodeSigningMapping::_onQueue_children(const std::string& parent) {
  QRVSQLiteDB* db = _onQueue_db();
  if (!db) return std::nullopt;
  QRVError error;
  auto children = db->childIdentifiersForParentIdentifier(parent, &error);
  if (!children && !isNotFound(error))
    QRVLogError("Error retrieving child bundles ids from DB with identifier {} : {}", parent, error.description());
  return children;
}

bool QRVCodeSigningMapping::_onQueue_wouldFormCycle(const std::string& childIdentifier,
                                                    const std::string& parentIdentifier) {
  // Walk up from the new parent; reaching the child closes a loop. The walk
  // stops at an ancestor seen before, so a loop already stored cannot hang it.
  std::set<std::string> seen;
  std::optional<std::string> ancestor = parentIdentifier;
  while (ancestor && seen.insert(*ancestor).second) {
    if (*ancestor == childIdentifier) return true;
    ancestor = _onQueue_parent(*ancestor);
  }
  return false;
}

// MARK: - Installer information

QRVCodeSigningMapping::Options QRVCodeSigningMapping::_parseOptions(const QRVPlist& options,
                                                                    const std::string& identifier) {
  Options parsed;
  if (options.isNone()) return parsed;
  if (!options.isDictionary()) {
    QRVLogError("Options for {} are not a dictionary; ignoring them: {}", identifier, options.description());
    return parsed;
  }
  if (const QRVPlist* value = options.get(kQRVDataContainerClassOption)) {
    if (value->type() == QRVPlist::Type::UInteger && value->uint64Value() < QRVContainerClassMax) {
      parsed.dataContainerClass = value->uint64Value();
    } else {
      QRVLogError("Option {} for {} is not a container class; ignoring: {}", kQRVDataContainerClassOption, identifier,
                  value->description());
    }
  }
  if (const QRVPlist* value = options.get(kQRVParentBundleIDOption)) {
    if (value->isString()) {
      parsed.parentIdentifier = value->stringValue();
    } else {
      QRVLogError("Option {} for {} is not a string; ignoring: {}", kQRVParentBundleIDOption, identifier,
                  value->description());
    }
  }
  auto readBool = [&](const char* key, bool* out) {
    const QRVPlist* value = options.get(key);
    if (!value) return;
    if (value->type() == QRVPlist::Type::Boolean) {
      *out = value->boolValue();
    } else {
      QRVLogError("Option {} for {} is not a boolean; ignoring: {}", key, identifier, value->description());
    }
  };
  readBool(kQRVRegisteredByCallerOption, &parsed.registeredByCaller);
  readBool(kQRVPlaceholderOption, &parsed.placeholder);
  readBool(kQRVAdvanceCopyOption, &parsed.advanceCopy);
  return parsed;
}

uint64_t QRVCodeSigningMapping::processCodeSigningInfo(const QRVPlist& codeSigningInfo,
                                                       const std::optional<std::string>& identifier,
                                                       const QRVPlist& options, QRVCommandQueue& commandQueue) {
  if (!identifier) {
    QRVLogError("Cannot process code signing info without an identifier");
    return QRVResultCode::kMissingIdentifier;
  }
  // Only a missing dictionary means "remove": anything else that is not a
  // dictionary is a malformed request, and must not wipe what is stored.
  if (!codeSigningInfo.isNone() && !codeSigningInfo.isDictionary()) {
    QRVLogError("Code signing info for {} is not a dictionary: {}", *identifier, codeSigningInfo.description());
    return QRVResultCode::kInvalidObject;
  }
  if (codeSigningInfo.isDictionary()) {
    const QRVPlist* entitlements = codeSigningInfo.get(kQRVCodeSigningEntitlementsKey);
    if (entitlements && !entitlements->isDictionary())
      QRVLogError("Entitlements of {} are not a dictionary; they count as none: {}", *identifier,
                  entitlements->description());
  }
  Options parsed = _parseOptions(options, *identifier);
  if (parsed.parentIdentifier && *parsed.parentIdentifier == *identifier) {
    QRVLogError("{} cannot be its own parent", *identifier);
    return QRVResultCode::kInvalidObject;
  }

  // Outside the queue: the look-up may fall back to the bundle container.
  std::optional<QRVPlist> oldEntitlements = entitlementsForIdentifier(*identifier);

  uint64_t result = QRVResultCode::kSuccess;
  queue_->sync([&] {
    try {
      result = _onQueue_processCodeSigningInfo(codeSigningInfo, *identifier, parsed, oldEntitlements, commandQueue);
    } catch (...) {
      std::shared_ptr<QRVServices> services = _services();
      if (services && services->globalConfiguration->isInternalImage())
        QRVReportUncaughtException(std::current_exception());
      QRVLogError("Exception processing code signing info for {}: {}", *identifier,
                  QRVExceptionDescription(std::current_exception()));
      result = QRVResultCode::kException;
    }
  });
  return result;
}

uint64_t QRVCodeSigningMapping::_onQueue_processCodeSigningInfo(const QRVPlist& codeSigningInfo,
                                                                const std::string& identifier, const Options& options,
                                                                const std::optional<QRVPlist>& passedOldEntitlements,
                                                                QRVCommandQueue& commandQueue) {
  QRVSQLiteDB* db = _onQueue_db();
  if (!db) {
    QRVLogError("Cannot process code signing info for {}: the database is unavailable", identifier);
    return QRVResultCode::kDatabaseFailed;
  }

  QRVError readError;
  std::shared_ptr<const QRVCodeSigningEntry> existing = db->codeSigningEntryWithIdentifier(identifier, &readError);
  if (!existing && !isNotFound(readError)) {
    QRVLogError("Error retrieving entry from DB with identifier {} : {}", identifier, readError.description());
    return readError.resultCode();
  }
  // A caller's own registration never replaces what an installed code
  // signature supplied. Checked here, on the queue, so that an install that
  // lands between the caller's check and this write is not overwritten.
  if (options.registeredByCaller && existing && existing->hasCodeSigningInfo() && !existing->isRegisteredByCaller())
    return QRVResultCode::kSuccess;

  // What the identifier claimed until now. The stored entry is the truth;
  // the entitlements read before entering the queue only stand in when
  // nothing is stored (they may come from the bundle container's copy).
  std::optional<QRVPlist> oldEntitlements = existing ? entitlementsFromEntry(existing.get()) : passedOldEntitlements;

  std::vector<QRVCodeSigningEntry> entries;
  std::vector<std::string> identifiers;

  QRVCodeSigningEntry entry;
  entry.setDataContainerClass(options.dataContainerClass);
  if (options.parentIdentifier) {
    const std::string& parent = *options.parentIdentifier;
    if (_onQueue_wouldFormCycle(identifier, parent)) {
      QRVLogError("{} cannot be a child of {}: {} is among its parents", identifier, parent, identifier);
      return QRVResultCode::kInvalidObject;
    }
    QRVError parentError;
    std::shared_ptr<const QRVCodeSigningEntry> parentStored = db->codeSigningEntryWithIdentifier(parent, &parentError);
    if (!parentStored && !isNotFound(parentError)) {
      QRVLogError("Error retrieving entry from DB with identifier {} : {}", parent, parentError.description());
      return parentError.resultCode();
    }
    QRVCodeSigningEntry parentEntry = parentStored ? *parentStored : QRVCodeSigningEntry();
    QRVCodeSigningEntry::ChildIdentifiers children =
        parentEntry.childBundleIdentifiers().value_or(QRVCodeSigningEntry::ChildIdentifiers());
    if (std::find(children.begin(), children.end(), identifier) == children.end()) {
      children.push_back(identifier);
      QRVLogDebug("Staging Child Bundles: {} for parent ID: {} by appending: {}", describeList(children), parent,
                  identifier);
      parentEntry.setChildBundleIdentifiers(children);
      entries.push_back(std::move(parentEntry));
      identifiers.push_back(parent);
    }
  }
  if (options.registeredByCaller) entry.setRegisteredByCaller(true);
  if (options.placeholder) entry.setPlaceholder(true);
  if (options.advanceCopy) entry.setAdvanceCopy(true);
  entry.setCodeSigningInfo(codeSigningInfo);
  // The database only ever adds children, so the stored ones are part of
  // what this identifier's entry will be; carrying them over lets identical
  // information compare equal and be left alone.
  if (existing) entry.setChildBundleIdentifiers(existing->childBundleIdentifiers());

  if (!existing || *existing != entry) {
    std::optional<QRVPlist> newEntitlements = entitlementsFromInfo(codeSigningInfo);

    if (claimsSystemContainer(oldEntitlements) && !claimsSystemContainer(newEntitlements)) {
      QRVLogNotice("Deleting system container for ID: {} because it is no longer in the entitlements", identifier);
      std::shared_ptr<QRVServices> services = _services();
      QRVError identityError;
      QRVContainerIdentityRef systemContainer =
          services ? QRVContainerIdentity::containerIdentityWithIdentifier(identifier, QRVContainerClassSystemData,
                                                                           *services->userIdentityCache, &identityError)
                   : nullptr;
      if (systemContainer) {
        _queueStageForDelete(
            systemContainer,
            [identifier](uint64_t code) {
              QRVLogError("Failed to destroy system container with identifier {}: {}", identifier, code);
            },
            commandQueue);
      } else {
        QRVLogError("Failed to create system container identity for {}: {}", identifier, identityError.description());
      }
    }

    GroupList newAppGroups = copyGroupEntitlement(identifier, newEntitlements, kQRVApplicationGroupsEntitlement);
    GroupList oldAppGroups = copyGroupEntitlement(identifier, oldEntitlements, kQRVApplicationGroupsEntitlement);
    if (newAppGroups || oldAppGroups)
      _onQueue_handleChangeFromOldGroupContainerIds(oldAppGroups, newAppGroups, QRVGroupTypeApplication, commandQueue);
    GroupList newSystemGroups = systemGroupIdentifiers(identifier, newEntitlements);
    GroupList oldSystemGroups = systemGroupIdentifiers(identifier, oldEntitlements);
    if (newSystemGroups || oldSystemGroups)
      _onQueue_handleChangeFromOldGroupContainerIds(oldSystemGroups, newSystemGroups, QRVGroupTypeSystem, commandQueue);

    QRVLogNotice("Reconciled; old app groups: {}, new app groups: {}, old system groups: {}, new system groups: {}",
                 describeList(oldAppGroups), describeList(newAppGroups), describeList(oldSystemGroups),
                 describeList(newSystemGroups));
    if (!entry.hasCodeSigningInfo()) entry = QRVCodeSigningEntry();
  }
  entries.push_back(std::move(entry));
  identifiers.push_back(identifier);

  std::optional<QRVError> writeError = _onQueue_setCodeSigningDictionaryValues(entries, identifiers);
  return writeError ? writeError->resultCode() : static_cast<uint64_t>(QRVResultCode::kSuccess);
}

void QRVCodeSigningMapping::_onQueue_handleChangeFromOldGroupContainerIds(const GroupList& oldIds,
                                                                          const GroupList& newIds, QRVGroupType type,
                                                                          QRVCommandQueue& commandQueue) {
  if (!oldIds && !newIds) return;
  if (oldIds && newIds && *oldIds == *newIds) return;
  // Groups gained need nothing: a group container is made the first time a
  // claimant asks for it.
  std::vector<std::string> removed;
  if (oldIds) {
    for (const std::string& group : *oldIds) {
      if (!newIds || std::find(newIds->begin(), newIds->end(), group) == newIds->end()) removed.push_back(group);
    }
  }
  _onQueue_removeReferenceForGroupIdentifiers(removed, type, commandQueue);
}

void QRVCodeSigningMapping::_onQueue_removeReferenceForGroupIdentifiers(
    const std::vector<std::string>& groupIdentifiers, QRVGroupType type, QRVCommandQueue& commandQueue) {
  if (groupIdentifiers.empty()) return;
  std::optional<QRVGroupReferenceCounts> counts = _onQueue_copyReferenceCountSetOfType(type);
  if (!counts) {
    // Without the counts nobody can tell the last claimant: keep everything.
    QRVLogError("Failed to get reference count information for group type: {}", static_cast<long>(type));
    return;
  }
  if (type == QRVGroupTypeSystem) {
    // System group containers hold data of system services that outlives
    // any one claimant; only the boot-time sweep removes them.
    QRVLogNotice("Would have removed system group container references for {}", describeList(groupIdentifiers));
    return;
  }
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return;
  services->userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
      [&](const QRVUserIdentityRef& user) {
        std::shared_ptr<QRVPerUserConfiguration> perUser =
            services->globalConfiguration->getPerUserConfigurationForUserIdentity(user);
        if (!perUser || !perUser->existsUserBaseDirectory()) return;
        QRVGroupReferenceCounts userCounts = *counts;
        for (const std::string& group : groupIdentifiers) {
          int64_t count = userCounts.count(group) ? userCounts[group] : 0;
          if (count == 1) {
            QRVError error;
            QRVContainerIdentityRef identity =
                QRVContainerIdentity::containerIdentityWithUserIdentity(user, group, QRVContainerClassAppGroup, &error);
            if (identity) {
              std::string userText = user->description();
              _queueStageForDelete(
                  identity,
                  [group, userText](uint64_t code) {
                    QRVLogError("Failed to destroy group container with identifier {} for {}: {}", group, userText,
                                code);
                  },
                  commandQueue);
            }
          } else {
            QRVLogNotice("Reference count for user: {}, ID: {} is {}", user->description(), group,
                         static_cast<long>(count));
          }
          if (count > 0) userCounts[group] = count - 1;
        }
      });
}

QRVCodeSigningMapping::GroupList QRVCodeSigningMapping::_claimedGroups(const std::string& identifier,
                                                                       const QRVCodeSigningEntry* entry,
                                                                       QRVGroupType type) {
  std::optional<QRVPlist> entitlements = entitlementsFromEntry(entry);
  if (!entitlements) return std::nullopt;
  const char* key = type == QRVGroupTypeApplication ? kQRVApplicationGroupsEntitlement : kQRVSystemGroupsEntitlement;
  const QRVPlist* value = entitlements->get(key);
  // Counted as the claims are read, so that whatever counts as a claim also
  // keeps its group alive: one string is a list of one, and an identifier
  // that lists a group twice still claims it once.
  GroupList groups = type == QRVGroupTypeApplication ? copyGroupEntitlement(identifier, entitlements, key)
                                                     : copySystemGroupEntitlement(identifier, entitlements);
  if (type == QRVGroupTypeSystem && !groups) value = entitlements->get(kQRVSystemGroupContainersEntitlement);
  if (!groups) {
    if (value)
      QRVLogError("identifier: {} has non-array type of group container IDs: {}", identifier, describeValue(value));
    return std::nullopt;
  }
  QRVLogDebug("Entitlements for identifier {} references container IDs: {}", identifier, describeList(groups));
  return groups;
}

std::optional<QRVGroupReferenceCounts> QRVCodeSigningMapping::_onQueue_copyReferenceCountSetOfType(QRVGroupType type) {
  std::optional<QRVGroupReferenceCounts>& kept = referenceCounts_[type == QRVGroupTypeApplication ? 0 : 1];
  if (kept) return kept;
  QRVSQLiteDB* db = _onQueue_db();
  if (!db) return std::nullopt;
  QRVGroupReferenceCounts counts;
  std::optional<QRVError> error = db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
      [&](const std::string& identifier, const std::shared_ptr<const QRVCodeSigningEntry>& entry) {
        if (GroupList groups = _claimedGroups(identifier, entry.get(), type))
          for (const std::string& group : *groups) counts[group]++;
      });
  if (error) {
    QRVLogError("Failed to enumerate code signing info: {}", error->description());
    return std::nullopt;
  }
  kept = std::move(counts);
  return kept;
}

void QRVCodeSigningMapping::_onQueue_countWrite(const std::string& identifier, const QRVCodeSigningEntry* before,
                                                const QRVCodeSigningEntry* after) {
  for (QRVGroupType type : {QRVGroupTypeApplication, QRVGroupTypeSystem}) {
    std::optional<QRVGroupReferenceCounts>& kept = referenceCounts_[type == QRVGroupTypeApplication ? 0 : 1];
    if (!kept) continue;
    if (GroupList groups = _claimedGroups(identifier, before, type)) {
      for (const std::string& group : *groups) {
        auto it = kept->find(group);
        if (it == kept->end() || it->second <= 0) {
          // The kept counts and the database disagree: trust the database.
          QRVLogError("Reference count for {} was already 0 when {} dropped it; counting again", group, identifier);
          kept.reset();
          break;
        }
        if (--it->second == 0) kept->erase(it);
      }
    }
    if (!kept) continue;
    if (GroupList groups = _claimedGroups(identifier, after, type))
      for (const std::string& group : *groups) (*kept)[group]++;
  }
}

void QRVCodeSigningMapping::_onQueue_forgetReferenceCounts() {
  referenceCounts_[0].reset();
  referenceCounts_[1].reset();
}

void QRVCodeSigningMapping::TEST_forgetReferenceCounts() {
  queue_->sync([&] { _onQueue_forgetReferenceCounts(); });
}

std::optional<QRVError> QRVCodeSigningMapping::_onQueue_setCodeSigningDictionaryValues(
    const std::vector<QRVCodeSigningEntry>& entries, const std::vector<std::string>& identifiers) {
  if (entries.size() != identifiers.size()) {
    return QRV_ERROR(QRVResultCode::kListLengthsDiffer, "{} entries for {} identifiers", entries.size(),
                     identifiers.size());
  }
  QRVSQLiteDB* db = _onQueue_db();
  if (!db) return QRV_ERROR(QRVResultCode::kDatabaseFailed, "the code signing database is unavailable");
  std::optional<QRVError> firstFailure;
  for (size_t i = 0; i < entries.size(); i++) {
    const QRVCodeSigningEntry& entry = entries[i];
    const std::string& identifier = identifiers[i];
    QRVError readError;
    std::shared_ptr<const QRVCodeSigningEntry> stored = db->codeSigningEntryWithIdentifier(identifier, &readError);
    if (!stored && !isNotFound(readError)) {
      QRVLogError("Error retrieving entry from DB with identifier {} : {}", identifier, readError.description());
      if (!firstFailure) firstFailure = readError;
      continue;
    }
    QRVError error;
    if (!entry.hasCodeSigningInfo()) {
      if (!stored) continue;
      if (db->deleteCodeSigningEntryWithIdentifier(identifier, &error)) {
        _onQueue_countWrite(identifier, stored.get(), nullptr);
        QRVLogNotice("Deleted Code Signing Mapping for ID: {}", identifier);
      } else {
        QRVLogError("Failed to delete code signing mapping for ID: {} : {}", identifier, error.description());
        if (!firstFailure) firstFailure = error;
      }
    } else if (!stored || *stored != entry) {
      if (db->addCodeSigningEntry(&entry, identifier, &error)) {
        _onQueue_countWrite(identifier, stored.get(), &entry);
        QRVLogNotice("Set Code Signing Mapping for ID: {} : {}", identifier, entry.description());
      } else {
        QRVLogError("Failed to set code signing mapping for ID: {} : {}", identifier, error.description());
        if (!firstFailure) firstFailure = error;
      }
    }
  }
  return firstFailure;
}

void QRVCodeSigningMapping::_queueStageForDelete(QRVContainerIdentityRef identity,
                                                 std::function<void(uint64_t)> onError, QRVCommandQueue& commandQueue) {
  std::shared_ptr<QRVServices> services = _services();
  if (!services) return;
  commandQueue.insertCommand(QRVCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
      {std::move(identity)}, /*useLocking=*/true, std::move(onError), std::move(services)));
}

// MARK: - Caller-registered entitlements

uint64_t QRVCodeSigningMapping::processCallerRegisteredEntitlements(const QRVPlist& entitlements,
                                                                    const std::optional<std::string>& identifier,
                                                                    QRVCommandQueue& commandQueue) {
  if (!identifier || entitlements.isNone()) return QRVResultCode::kMissingIdentifier;
  if (!entitlements.isDictionary()) {
    QRVLogError("Entitlements registered for {} are not a dictionary: {}", *identifier, entitlements.description());
    return QRVResultCode::kInvalidObject;
  }
  std::shared_ptr<const QRVCodeSigningEntry> entry;
  QRVError error;
  queue_->sync([&] { entry = _onQueue_entry(*identifier, &error); });
  if (!entry && !isNotFound(error)) return error.resultCode();

  bool reRegister = !entry || !entry->hasCodeSigningInfo();
  if (!reRegister && entry->isRegisteredByCaller() && entitlementsFromEntry(entry.get()) != entitlements) {
    QRVLogNotice("{} has changed entitlements. Re-registering.", *identifier);
    reRegister = true;
  }
  if (!reRegister) return QRVResultCode::kSuccess;
  QRVPlist info = QRVPlist::dictionary();
  info.set(kQRVCodeSigningEntitlementsKey, entitlements);
  QRVPlist options = QRVPlist::dictionary();
  options.set(kQRVRegisteredByCallerOption, QRVPlist::boolean(true));
  return processCodeSigningInfo(info, identifier, options, commandQueue);
}

// MARK: - Queries

std::optional<QRVPlist> QRVCodeSigningMapping::entitlementsForIdentifier(const std::string& identifier) {
  std::optional<QRVPlist> entitlements;
  queue_->sync([&] {
    std::shared_ptr<const QRVCodeSigningEntry> entry = _onQueue_entry(identifier, nullptr);
    entitlements = entitlementsFromEntry(entry.get());
  });
  if (entitlements) return entitlements;
  return _entitlementsFromBundleContainer(identifier);
}

std::optional<QRVPlist> QRVCodeSigningMapping::_entitlementsFromBundleContainer(const std::string& identifier) {
  std::shared_ptr<QRVServices> services = _services();
  if (!services || !services->containerCache) return std::nullopt;
  QRVError error;
  QRVContainerIdentityRef bundle = QRVContainerIdentity::containerIdentityWithIdentifier(
      identifier, QRVContainerClassAppBundle, *services->userIdentityCache, &error);
  if (!bundle) return std::nullopt;
  QRVMetadataRef metadata = services->containerCache->containerForContainerIdentity(*bundle, nullptr);
  if (!metadata || !metadata->info().isDictionary()) return std::nullopt;
  const QRVPlist* cached = metadata->info().get(kCachedCodeSigningInfoKey);
  if (!cached || !cached->isDictionary()) return std::nullopt;

  QRVLogNotice("Migrating code signing info from bundle container upon request for {}", identifier);
  QRVPlist info = *cached;
  const QRVPlist* cachedEntitlements = cached->get(kCachedEntitlementsKey);
  if (cachedEntitlements) info.set(kQRVCodeSigningEntitlementsKey, *cachedEntitlements);
  QRVCodeSigningEntry entry(info, QRVContainerClassAppData);
  queue_->sync([&] {
    QRVSQLiteDB* db = _onQueue_db();
    if (!db) return;
    // The installer may have written real information meanwhile; it wins.
    QRVError readError;
    if (db->codeSigningEntryWithIdentifier(identifier, &readError) || !isNotFound(readError)) return;
    QRVError writeError;
    if (db->addCodeSigningEntry(&entry, identifier, &writeError))
      _onQueue_countWrite(identifier, nullptr, &entry);
    else
      QRVLogError("Failed to write code signing info to DB for {} : {}", identifier, writeError.description());
  });
  return entitlementsFromInfo(info);
}

std::optional<QRVPlist> QRVCodeSigningMapping::getCodeSigningInfoForIdentifier(const std::string& identifier) {
  std::optional<QRVPlist> info;
  queue_->sync([&] {
    std::shared_ptr<const QRVCodeSigningEntry> entry = _onQueue_entry(identifier, nullptr);
    if (const QRVPlist* external = codeSigningInfoForEntry(entry.get(), /*externalRequest=*/true)) info = *external;
  });
  return info;
}

std::shared_ptr<const QRVCodeSigningEntry> QRVCodeSigningMapping::codeSigningEntryForIdentifier(
    const std::string& identifier, QRVError* error) {
  std::shared_ptr<const QRVCodeSigningEntry> entry;
  queue_->sync([&] { entry = _onQueue_entry(identifier, error); });
  return entry;
}

std::vector<std::string> QRVCodeSigningMapping::appGroupIdentifiersForIdentifier(const std::string& identifier) {
  return copyGroupEntitlement(identifier, entitlementsForIdentifier(identifier), kQRVApplicationGroupsEntitlement)
      .value_or(std::vector<std::string>());
}

std::vector<std::string> QRVCodeSigningMapping::systemGroupIdentifiersForIdentifier(const std::string& identifier) {
  return systemGroupIdentifiers(identifier, entitlementsForIdentifier(identifier)).value_or(std::vector<std::string>());
}

bool QRVCodeSigningMapping::identifierHasSystemContainer(const std::string& identifier) {
  return claimsSystemContainer(entitlementsForIdentifier(identifier));
}

uint64_t QRVCodeSigningMapping::dataContainerTypeForIdentifier(const std::string& identifier) {
  std::shared_ptr<const QRVCodeSigningEntry> entry = codeSigningEntryForIdentifier(identifier, nullptr);
  return entry ? entry->dataContainerClass() : 0;
}

bool QRVCodeSigningMapping::identifierHasCallerRegisteredEntitlements(const std::string& identifier) {
  std::shared_ptr<const QRVCodeSigningEntry> entry = codeSigningEntryForIdentifier(identifier, nullptr);
  return entry && entry->isRegisteredByCaller();
}

std::optional<std::string> QRVCodeSigningMapping::parentIdentifierForChildIdentifier(
    const std::string& childIdentifier) {
  // Called by the container cache with its lock held: the queue's jobs
  // never wait for the cache, so this cannot close a cycle.
  std::optional<std::string> parent;
  queue_->sync([&] { parent = _onQueue_parent(childIdentifier); });
  return parent;
}

std::optional<std::vector<std::string>> QRVCodeSigningMapping::childBundleIdentifiersForParentIdentifier(
    const std::string& parent) {
  std::optional<std::vector<std::string>> children;
  queue_->sync([&] { children = _onQueue_children(parent); });
  return children;
}

std::optional<std::vector<std::string>> QRVCodeSigningMapping::identifiersWithError(QRVError* error) {
  std::optional<std::vector<std::string>> identifiers;
  queue_->sync([&] {
    QRVSQLiteDB* db = _onQueue_db();
    identifiers = db ? db->identifiersWithError(error) : std::vector<std::string>();
  });
  return identifiers;
}

std::optional<QRVGroupReferenceCounts> QRVCodeSigningMapping::copyReferenceCountSetOfType(QRVGroupType type) {
  std::optional<QRVGroupReferenceCounts> counts;
  queue_->sync([&] { counts = _onQueue_copyReferenceCountSetOfType(type); });
  return counts;
}

// MARK: - Removal and invalidation

uint64_t QRVCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string& identifier, QRVCommandQueue& commandQueue) {
  std::vector<std::string> all{identifier};
  if (auto children = childBundleIdentifiersForParentIdentifier(identifier))
    all.insert(all.end(), children->begin(), children->end());
  uint64_t result = QRVResultCode::kSuccess;
  for (const std::string& member : all) {
    uint64_t code = processCodeSigningInfo(QRVPlist(), member, QRVPlist(), commandQueue);
    if (code != QRVResultCode::kSuccess) {
      QRVLogError("Failed to clear entitlements for {} : {}", member, code);
      result = code;
    }
  }
  return result;
}

uint64_t QRVCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier) {
  bool ok = false;
  queue_->sync([&] {
    QRVSQLiteDB* db = _onQueue_db();
    QRVError error;
    ok = db && db->invalidateCodeSigningForIdentifierAndAllChildren(identifier, &error);
    if (!ok) QRVLogError("failed to invalidate identifier {}: {}", identifier, error.description());
  });
  return ok ? QRVResultCode::kSuccess : QRVResultCode::kDatabaseFailed;
}

bool QRVCodeSigningMapping::invalidateCodeSigningInfoForIdentifier(const std::string& identifier, QRVError* error) {
  bool ok = false;
  queue_->sync([&] {
    QRVSQLiteDB* db = _onQueue_db();
    if (!db) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "failed to invalidate identifier {}", identifier));
      return;
    }
    ok = db->invalidateCodeSigningWithIdentifier(identifier, error);
  });
  return ok;
}

bool QRVCodeSigningMapping::removeAllAdvanceCopiesWithError(QRVError* error) {
  bool ok = false;
  queue_->sync([&] {
    QRVSQLiteDB* db = _onQueue_db();
    if (!db) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kDatabaseFailed, "the code signing database is unavailable"));
      return;
    }
    ok = db->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(error);
    _onQueue_forgetReferenceCounts();
  });
  return ok;
}
