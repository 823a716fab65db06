// Deleting, replacing and wiping containers.
//
// A replace is three renames on one volume: old directory to a parking place
// in staging, new directory to the destination, parked directory to death
// row. Before the first rename a journal naming all four places is written
// (atomically, flushed), and it is removed only after the last, so that at
// any instant one of these holds on disk: the old directory is at its place,
// or the new one is at the destination, or the old one is parked and the
// journal says where it came from. Start-up recovery reads the journals left
// behind and puts the old directory back when neither is in place.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <set>

#include "base/QRVLog.h"
#include "core/QRVCommandStageForDelete.h"
#include "core/QRVCrashPoints.h"
#include "core/QRVExceptionReporter.h"
#include "core/QRVLocks.h"
#include "fs/QRVDictionaryAdditions.h"
#include "fs/QRVPathComponents.h"
#include "model/QRVContainerCache.h"
#include "model/QRVPerUserConfiguration.h"
#include "operations/QRVClientConnection.h"

namespace {

constexpr const char* kOldURLKey = "QRVReplaceOperationOldURL";
constexpr const char* kNewURLKey = "QRVReplaceOperationNewURL";
constexpr const char* kStagingURLKey = "QRVReplaceOperationStagingURL";
constexpr const char* kDestURLKey = "QRVReplaceOperationDestURL";

// The data classes: the only ones whose contents belong to an application's
// user and may be wiped.
// Only data containers are wiped: a bundle is replaced by its installer, a
// group is shared by several applications, and a system container belongs
// to a service that is not asked.
bool isWipeableDataClass(QRVContainerClass c) { return QRVContainerClassIsData(c); }

// Widens a connection for the span of a wipe, whose look-up and creation
// are on behalf of an identifier the caller was found entitled to wipe.
class UnrestrictedScope {
 public:
  explicit UnrestrictedScope(QRVClientConnection& c) : connection_(c), was_(c.isUnrestricted()) {
    c.setUnrestricted(true);
  }
  ~UnrestrictedScope() { connection_.setUnrestricted(was_); }

 private:
  QRVClientConnection& connection_;
  const bool was_;
};

// Where a journal's paths may lie: the trees holding containers (live and
// transient, device-wide and each known user's) and the staging directories
// that the old container is parked in.
struct JournalTrees {
  std::vector<std::string> containers;
  std::vector<std::string> staging;
};

JournalTrees journalTrees(QRVServices& services) {
  QRVGlobalConfiguration& config = *services.globalConfiguration;
  JournalTrees trees;
  trees.containers = {config.sharedContainersDirectory(), config.transientDirectory()};
  trees.staging = {config.stagingDirectory()};
  auto addUser = [&](const QRVUserIdentityRef& user) {
    if (!user) return;
    std::shared_ptr<QRVPerUserConfiguration> perUser = config.getPerUserConfigurationForUserIdentity(user);
    trees.containers.push_back(perUser->userBaseDirectory());
    trees.staging.push_back(perUser->stagingDirectory());
  };
  addUser(services.userIdentityCache->defaultUserIdentity());
  services.userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(addUser);
  for (std::string& tree : trees.containers) tree = QRVPathWithoutTrailingSlashes(tree);
  for (std::string& tree : trees.staging) tree = QRVPathWithoutTrailingSlashes(tree);
  return trees;
}

// Whether `path` is spelled as a plain absolute path: no empty, "." or ".."
// component that would make its text say something other than where it leads.
bool isPlainAbsolutePath(const std::string& path) {
  if (path.empty() || path[0] != '/') return false;
  std::vector<std::string> components = QRVPathComponents::split(path);
  for (size_t i = 1; i < components.size(); i++)
    if (components[i] == "." || components[i] == "..") return false;
  return path.find("//") == std::string::npos;
}

// Whether `path` lies strictly inside `tree`, reached from it through real
// directories only: a link on the way, or the item itself being a link,
// would make the rename act somewhere the text does not say.
bool liesInside(QRVFileManager& fm, const std::string& path, const std::string& tree) {
  if (path.size() <= tree.size() + 1 || path.compare(0, tree.size(), tree) != 0 || path[tree.size()] != '/')
    return false;
  std::optional<std::string> realTree = fm.realPathForURL(tree, tree);
  std::optional<std::string> real = fm.realPathForURL(path, tree);
  return realTree && real && *real == *realTree + path.substr(tree.size());
}

bool liesInsideAny(QRVFileManager& fm, const std::string& path, const std::vector<std::string>& trees) {
  for (const std::string& tree : trees)
    if (liesInside(fm, path, tree)) return true;
  return false;
}

// A container's place: inside a container tree, and not in staging (which a
// user's container tree holds).
bool isContainerPlace(QRVFileManager& fm, const std::string& path, const JournalTrees& trees) {
  for (const std::string& staging : trees.staging)
    if (path == staging || path.compare(0, staging.size() + 1, staging + "/") == 0) return false;
  return liesInsideAny(fm, path, trees.containers);
}

// A parking place: a UUID-named item directly in a staging directory.
bool isParkingPlace(QRVFileManager& fm, const std::string& path, const JournalTrees& trees) {
  if (!QRVUUID::fromString(QRVLastPathComponent(path))) return false;
  const std::string parent = QRVPathComponents::parentDirectory(path);
  for (const std::string& staging : trees.staging)
    if (parent == staging && liesInside(fm, path, staging)) return true;
  return false;
}

}  // namespace

bool QRVClientConnection::deleteContainerWithContainerIdentity(const QRVContainerIdentityRef& containerIdentity,
                                                               bool transient, QRVError* error) {
  QRVMetadataRef metadata = createOrLookupContainerWithContainerIdentity(containerIdentity, /*createIfNecessary=*/false,
                                                                         transient, /*useLocking=*/true, error);
  if (!metadata) return false;
  stageContainerIdentitiesForDelete({metadata->containerIdentity()});
  return true;
}

void QRVClientConnection::stageContainerIdentitiesForDelete(std::vector<QRVContainerIdentityRef> identities) {
  commandQueue_->insertCommand(QRVCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
      std::move(identities), true, nullptr, services_));
}

bool QRVClientConnection::_writeToDiskReplaceAt(const std::string& url, const std::string& oldURL,
                                                const std::string& newURL, const std::string& stagingURL,
                                                const std::string& destinationURL, QRVError* error) {
  if (oldURL.empty() || newURL.empty() || stagingURL.empty() || destinationURL.empty())
    return QRVFail(error, QRV_ERROR(QRVResultCode::kFileMissingField,
                                    "Invalid Replace File Info: old: {}, new: {}, staging: {}, dest: {}", oldURL,
                                    newURL, stagingURL, destinationURL));
  QRVPlist journal = QRVPlist::dictionary()
                         .set(kOldURLKey, QRVPlist::string(oldURL))
                         .set(kNewURLKey, QRVPlist::string(newURL))
                         .set(kStagingURLKey, QRVPlist::string(stagingURL))
                         .set(kDestURLKey, QRVPlist::string(destinationURL));
  QRVError underlying;
  if (!QRV_writeToURL(*services_->fileManager, journal, url, &underlying))
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileNotWritten, underlying,
                                               "Failed to write replace dictionary to URL {}", url));
  return true;
}

std::optional<QRVPlist> QRVClientConnection::_readAndValidateReplaceFileAtUrl(const std::string& url, QRVError* error) {
  QRVError underlying;
  std::optional<QRVPlist> journal = QRV_dictionaryWithContentsOfURL(*services_->fileManager, url, &underlying);
  if (!journal) {
    if (underlying.isPOSIX()) {
      QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileUnreadableOrRollbackFailed, underlying,
                                          "Failed to read replace file at URL {}", url));
    } else {
      QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileUnreadableOrRollbackFailed, underlying,
                                          "Bad Data in replace file: {}", url));
    }
    return std::nullopt;
  }
  auto path = [&](const char* key) -> std::string {
    const QRVPlist* v = journal->get(key);
    return v && v->isString() && !v->stringValue().empty() && v->stringValue()[0] == '/' ? v->stringValue()
                                                                                         : std::string();
  };
  std::string oldURL = path(kOldURLKey), newURL = path(kNewURLKey), staging = path(kStagingURLKey),
              dest = path(kDestURLKey);
  if (oldURL.empty() || newURL.empty() || staging.empty() || dest.empty()) {
    QRVFail(error,
            QRV_ERROR(QRVResultCode::kFileUnreadableOrRollbackFailed,
                      "Invalid replace data: Old: {}, New: {}, Staging: {}, Dest: {}", oldURL, newURL, staging, dest));
    return std::nullopt;
  }
  oldURL = QRVPathWithoutTrailingSlashes(oldURL);
  newURL = QRVPathWithoutTrailingSlashes(newURL);
  staging = QRVPathWithoutTrailingSlashes(staging);
  dest = QRVPathWithoutTrailingSlashes(dest);
  // Recovery renames what the journal names, as root: every path must be one
  // this daemon could have written, inside its own trees under the root.
  QRVFileManager& fm = *services_->fileManager;
  const JournalTrees trees = journalTrees(*services_);
  auto contained = [&](const std::string& place, bool parked) {
    return isPlainAbsolutePath(place) &&
           (parked ? isParkingPlace(fm, place, trees) : isContainerPlace(fm, place, trees));
  };
  if (!contained(oldURL, false) || !contained(newURL, false) || !contained(staging, true) || !contained(dest, false)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kFileUnreadableOrRollbackFailed,
                             "Replace data names a place outside the daemon's trees: Old: {}, New: {}, Staging: {}, "
                             "Dest: {}",
                             oldURL, newURL, staging, dest));
    return std::nullopt;
  }
  return QRVPlist::dictionary()
      .set(kOldURLKey, QRVPlist::string(oldURL))
      .set(kNewURLKey, QRVPlist::string(newURL))
      .set(kStagingURLKey, QRVPlist::string(staging))
      .set(kDestURLKey, QRVPlist::string(dest));
}

std::optional<std::vector<std::string>> QRVClientConnection::_replaceFileURLs(QRVError* error) {
  const std::string replaceDirectory = services_->globalConfiguration->replaceDirectory();
  QRVError listError;
  std::optional<std::vector<std::string>> journals =
      services_->fileManager->urlsForItemsInDirectoryAtURL(replaceDirectory, &listError);
  if (journals) return journals;
  // No replace directory: no replace was ever left unfinished.
  if (listError.isPOSIX() && listError.code() == ENOENT) return std::vector<std::string>();
  QRVLogError("Failed to get items at replace URL {} : {}", replaceDirectory, listError.description());
  QRVFail(error, listError);
  return std::nullopt;
}

bool QRVClientConnection::_stagingItemsNamedByReplaceFiles(std::set<std::string>* names) {
  QRVFileManager& fm = *services_->fileManager;
  std::optional<std::vector<std::string>> journals = _replaceFileURLs(nullptr);
  if (!journals) return false;
  for (const std::string& journalURL : *journals) {
    // Read as written, unvalidated: this only keeps things, and a journal
    // that recovery has not judged yet may still be the only record of
    // where an old container is parked.
    QRVError readError;
    std::optional<QRVPlist> journal = QRV_dictionaryWithContentsOfURL(fm, journalURL, &readError);
    const QRVPlist* staging = journal ? journal->get(kStagingURLKey) : nullptr;
    if (!staging || !staging->isString()) {
      QRVLogError("Replace file {} cannot be read: {}", journalURL, readError.description());
      return false;
    }
    names->insert(QRVLastPathComponent(QRVPathWithoutTrailingSlashes(staging->stringValue())));
  }
  return true;
}

bool QRVClientConnection::_recoverFromReplaceOperationsWithError(QRVError* error) {
  QRVFileManager& fm = *services_->fileManager;
  std::optional<std::vector<std::string>> journals = _replaceFileURLs(error);
  if (!journals) return false;
  for (const std::string& journalURL : *journals) {
    QRVError readError;
    std::optional<QRVPlist> journal = _readAndValidateReplaceFileAtUrl(journalURL, &readError);
    if (!journal) {
      QRVLogError("Discarding replace file {}: {}", journalURL, readError.description());
    } else {
      const std::string& oldURL = journal->stringForKey(kOldURLKey);
      const std::string& staging = journal->stringForKey(kStagingURLKey);
      const std::string& dest = journal->stringForKey(kDestURLKey);
      QRVLogDebug("Doing a replace of {} with info: {}", journalURL, journal->description());
      // The old directory in place: the swap never started. The new one at
      // the destination: it finished, and the parked directory is left for
      // the next cleanup. Neither: the old directory is parked; put it back.
      // Nothing anywhere: the replace never got as far as its first move, or
      // what it moved is gone; there is nothing to put back, and keeping the
      // journal would stop every later start at it.
      const bool oneInPlace = fm.directoryExistsAtURL(oldURL) || fm.directoryExistsAtURL(dest);
      const bool nothingLeft = !oneInPlace && fm.itemDoesNotExistAtURL(staging) && fm.itemDoesNotExistAtURL(oldURL) &&
                               fm.itemDoesNotExistAtURL(dest);
      if (nothingLeft) {
        QRVLogNotice("Discarding replace file {}: nothing to move back ({}, {} and {} are all absent)", journalURL,
                     staging, oldURL, dest);
      } else if (!oneInPlace) {
        QRVLogNotice("Recovering from failed replace by moving: {} to {}", staging, oldURL);
        QRVError moveError;
        if (!fm.moveItemAtURL(staging, oldURL, &moveError))
          return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileUnreadableOrRollbackFailed, moveError,
                                                     "Failed to recover replace move: {} to {}", staging, oldURL));
      }
    }
    QRVError discardError;
    if (!_moveItemAtURLToDeathRow(journalURL, /*isDir=*/false, /*startDeletionThread=*/false, &discardError))
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileNotMovedOrRemoved, discardError,
                                                 "Failed to remove replace file at {}", journalURL));
  }
  return true;
}

bool QRVClientConnection::replaceContainerIdentity(const QRVContainerIdentityRef& oldIdentity,
                                                   const QRVContainerIdentityRef& newIdentity, bool preserveOldUUID,
                                                   bool startDeletionThread, QRVError* error) {
  if (!oldIdentity || !newIdentity)
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "Cannot lookup a nil container identity."));
  const QRVContainerClass containerClass = newIdentity->containerClass();
  if (!newIdentity->uuid())
    return QRVFail(error,
                   QRV_ERROR(QRVResultCode::kInvalidObject, "Can't act on an invalid object: newUUID: {}, Class: {}",
                             "(null)", containerClass));
  if (!QRVContainerClassIsValid(containerClass))
    return QRVFail(
        error, QRV_ERROR(QRVResultCode::kInvalidObject, "Can't act on an invalid container class: {}", containerClass));
  if (oldIdentity->containerClass() != containerClass)
    return QRVFail(error, QRV_ERROR(QRVResultCode::kDifferentClasses,
                                    "Can't replace containers of different class types: {} and {}",
                                    oldIdentity->containerClass(), containerClass));
  if (preserveOldUUID && !oldIdentity->uuid())
    return QRVFail(
        error, QRV_ERROR(QRVResultCode::kInvalidObject, "Can't have a nil oldContainerUUID when preserving the UUID"));
  const QRVUserIdentityRef& userIdentity = oldIdentity->userIdentity();
  if (!QRVUserIdentityEqual()(userIdentity, newIdentity->userIdentity()))
    return QRVFail(
        error,
        QRV_ERROR(QRVResultCode::kDifferentUserIdentities, "Can't replace containers of different personas: {} and {}",
                  userIdentity ? userIdentity->description() : "(null)",
                  newIdentity->userIdentity() ? newIdentity->userIdentity()->description() : "(null)"));

  QRVFileManager& fm = *services_->fileManager;
  QRVGlobalConfiguration& config = *services_->globalConfiguration;
  QRVContainerCache& cache = *services_->containerCache;
  try {
    QRVGlobalWriteLock lock;

    // The old container is the live one; the new one is usually a transient
    // container prepared for the purpose, else another live one.
    // A cache that cannot answer (unreadable class directory, vanished
    // metadata) is reported as such, not as a missing container.
    QRVError cacheError;
    auto find = [&](const QRVContainerIdentity& identity, bool transientFirst) -> QRVMetadataRef {
      for (bool transient : {transientFirst, !transientFirst}) {
        QRVError e;
        QRVMetadataRef m = cache.containerForContainerIdentity(identity, transient, false, &e);
        if (m && (!identity.uuid() || m->uuid() == *identity.uuid())) return m->withTransient(transient);
        if (!m && !QRVContainerCache::isNotFoundError(e)) cacheError = e;
      }
      return nullptr;
    };
    auto notFound = [&](const QRVContainerIdentity& identity) {
      if (!cacheError.code())
        return QRVFail(error, QRV_ERROR(QRVResultCode::kNoSuchContainer, "No Container with identity: {}",
                                        identity.description()));
      return QRVFail(error, cacheError);
    };
    QRVMetadataRef oldMetadata = find(*oldIdentity, false);
    if (!oldMetadata) return notFound(*oldIdentity);
    QRVMetadataRef newMetadata = find(*newIdentity, true);
    if (!newMetadata) return notFound(*newIdentity);
    const std::string oldURL = QRVPathWithoutTrailingSlashes(oldMetadata->url());
    const std::string newURL = QRVPathWithoutTrailingSlashes(newMetadata->url());
    if (oldURL == newURL)
      return QRVFail(error, QRV_ERROR(QRVResultCode::kSameContainer, "Can't replace the same container at {}", oldURL));
    if (!QRVUUID::fromString(QRVLastPathComponent(newURL)))
      return QRVFail(
          error, QRV_ERROR(QRVResultCode::kUnexpectedPath, "Invalid URL (last path component not UUID): {}", newURL));

    const QRVUUID keptUUID = preserveOldUUID ? *oldIdentity->uuid() : *newIdentity->uuid();
    const bool transient = oldMetadata->transient();
    std::optional<std::string> parent =
        config.containerDirectoryURLForUserIdentity(userIdentity, containerClass, transient);
    if (!parent)
      return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject, "Can't act on an invalid container class: {}",
                                      containerClass));
    const std::string dest = QRVPathWithoutTrailingSlashes(*parent) + "/" + keptUUID.string();
    // When the old UUID is kept the destination is the old directory's own
    // place, which the first rename empties.
    if (dest != oldURL) {
      if (fm.itemExistsAtURL(dest))
        return QRVFail(error, QRV_ERROR(QRVResultCode::kDestinationExists, "Container already exists at {}", dest));
      QRVError listError;
      auto existing = cache.allContainersForUserIdentity(userIdentity, containerClass, transient, &listError);
      if (existing) {
        for (const QRVMetadataRef& m : *existing) {
          if (QRVPathWithoutTrailingSlashes(m->url()) == dest)
            return QRVFail(error, QRV_ERROR(QRVResultCode::kDestinationExists,
                                            "Container with identifier: {}, class: {}, transient: {} already exists",
                                            m->identifier(), containerClass, transient ? 1 : 0));
        }
      }
    }

    const std::string stagingParent = config.stagingDirectoryURLForUserIdentity(userIdentity, containerClass);
    const std::string staging = QRVPathWithoutTrailingSlashes(stagingParent) + "/" + QRVUUID::random().string();
    const std::string replaceDirectory = config.replaceDirectory();
    const std::string journalURL = QRVPathWithoutTrailingSlashes(replaceDirectory) + "/" + QRVUUID::random().string() + ".plist";
    // While nothing has moved, a failure takes the journal with it: a
    // journal naming nothing to put back would only stand in the way of
    // every later start's recovery. It is removed in place, which needs no
    // room on death row.
    auto discardJournal = [&] {
      QRVError removeError;
      if (!fm.removeFileAtURL(journalURL, &removeError))
        QRVLogError("Failed to remove replace file {}: {}", journalURL, removeError.description());
    };
    QRVError step;
    if (!fm.createDirectoryAtURL(replaceDirectory, true, 0755, &step) ||
        !fm.createDirectoryAtURL(stagingParent, true, 0755, &step)) {
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileNotWritten, step,
                                                 "Failed to prepare the replace file's directories: {}, {}",
                                                 replaceDirectory, stagingParent));
    }
    if (!_writeToDiskReplaceAt(journalURL, oldURL, newURL, staging, dest, &step)) {
      // The file may be in place and only its directory's flush have failed.
      discardJournal();
      QRVLogError("Failed to write replace file: {}", step.description());
      return QRVFail(error, step);
    }
    QRVCrashPoint(*services_, "replace.journal-written");

    // Park the old directory; from here on the journal knows where it is.
    if (!fm.moveItemAtURL(oldURL, staging, &step)) {
      QRVError parkError = QRV_ERROR_UNDERLYING(QRVResultCode::kOldNotMovedAside, step,
                                                "Failed to move old {} to staging {}", oldURL, staging);
      // A rename is all or nothing, but the journal goes only when the disk
      // agrees that nothing moved.
      if (fm.directoryExistsAtURL(oldURL) && fm.itemDoesNotExistAtURL(staging)) discardJournal();
      return QRVFail(error, parkError);
    }
    if (!cache.removeContainerForUserIdentity(userIdentity, containerClass, oldMetadata->identifier(), transient,
                                              &step))
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kCacheRemoveFailed, step,
                                                 "Failed to remove from cache id: {}, class: {}, transient: {}",
                                                 oldMetadata->identifier(), containerClass, transient ? 1 : 0));
    if (services_->codeSigning->invalidateCodeSigningInfoForIdentifierAndItsChildren(oldMetadata->identifier()) !=
        QRVResultCode::kSuccess)
      QRVLogError("Failed to invalidate code signing info for {}", oldMetadata->identifier());
    QRVCrashPoint(*services_, "replace.old-parked");

    // Puts the parked old container back and makes the cache know it again;
    // the journal is then moot. When the move back fails the journal stays,
    // so the next start finishes the job, and the answer is 35.
    auto unparkOld = [&]() -> bool {
      QRVError backError;
      if (!fm.moveItemAtURL(staging, oldURL, &backError))
        return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileUnreadableOrRollbackFailed, backError,
                                                   "Failed to recover replace move: {} to {}", staging, oldURL));
      cache.addContainerMetadata(oldMetadata, oldURL, transient, true, nullptr);
      discardJournal();
      return true;
    };

    // The kept UUID goes into the new container's metadata before it moves,
    // so that whenever it is at the destination its metadata is right.
    QRVMetadataRef placed = newMetadata->withUUID(keptUUID)->withURL(dest)->withTransient(transient);
    if (keptUUID != newMetadata->uuid() && !placed->withURL(newURL)->writeMetadataToDisk(fm, config, &step)) {
      if (!unparkOld()) return false;
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kCacheAddFailed, step,
                                                 "Failed to add to cache: {}, url: {}, transient: {}",
                                                 newIdentity->description(), dest, transient ? 1 : 0));
    }

    if (!fm.moveItemAtURL(newURL, dest, &step)) {
      QRVError replaceError = QRV_ERROR_UNDERLYING(QRVResultCode::kNewNotMovedIntoPlace, step,
                                                   "Failed to replace: {} with: {} at: {}", oldURL, newURL, dest);
      if (!unparkOld()) return false;
      // The new container keeps its own identity where it is.
      if (keptUUID != newMetadata->uuid()) newMetadata->writeMetadataToDisk(fm, config, nullptr);
      return QRVFail(error, replaceError);
    }
    QRVCrashPoint(*services_, "replace.new-placed");

    if (!cache.removeContainerForUserIdentity(userIdentity, containerClass, newMetadata->identifier(),
                                              newMetadata->transient(), &step))
      return QRVFail(error,
                     QRV_ERROR_UNDERLYING(QRVResultCode::kCacheRemoveFailed, step,
                                          "Failed to remove from cache id: {}, class: {}, transient: {}",
                                          newMetadata->identifier(), containerClass, newMetadata->transient() ? 1 : 0));
    if (oldMetadata->identifier() != newMetadata->identifier())
      cache.setSandboxContainerMappingForUserIdentity(userIdentity, oldMetadata->identifier(), containerClass,
                                                      std::nullopt);
    if (!cache.addContainerMetadata(placed, dest, transient, true, &step))
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kCacheAddFailed, step,
                                                 "Failed to add to cache: {}, url: {}, transient: {}",
                                                 newIdentity->description(), dest, transient ? 1 : 0));
    QRVCrashPoint(*services_, "replace.cache-updated");

    if (!_moveItemAtURLToDeathRow(staging, true, startDeletionThread, &step))
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileNotMovedOrRemoved, step,
                                                 "Failed to remove staging dir: {}", staging));
    QRVCrashPoint(*services_, "replace.staging-removed");
    if (!_moveItemAtURLToDeathRow(journalURL, /*isDir=*/false, /*startDeletionThread=*/false, &step))
      return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileNotMovedOrRemoved, step,
                                                 "Failed to remove replace file: {}", journalURL));
    return true;
  } catch (...) {
    if (config.isInternalImage()) QRVReportUncaughtException(std::current_exception());
    return QRVFail(error, QRV_ERROR(QRVResultCode::kException, "Got exception: {} : {}",
                                    QRVExceptionDescription(std::current_exception()), "(no call stack)"));
  }
}

bool QRVClientConnection::deleteDataContainerContentWithContainerIdentity(
    const QRVContainerIdentityRef& containerIdentity, QRVError* error) {
  if (!containerIdentity || containerIdentity->identifier().empty())
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidInput, "Can't wipe container with nil identifier: {}",
                                    containerIdentity ? containerIdentity->description() : "(null)"));
  const std::string& identifier = containerIdentity->identifier();
  const QRVContainerClass containerClass = containerIdentity->containerClass();
  if (!QRVContainerClassIsValid(containerClass))
    return QRVFail(error,
                   QRV_ERROR(QRVResultCode::kInvalidObject, "Can't wipe container with of type: {}, identifier: {}",
                             containerClass, identifier));
  if (!isWipeableDataClass(containerClass))
    return QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidObject,
                                    "Can't wipe container non-data container of type: {}, identifier: {}",
                                    containerClass, identifier));
  bool entitled = unrestricted_;
  if (!entitled && entitledWipeIdentifiers_) {
    for (const QRVPlist& v : *entitledWipeIdentifiers_)
      if (v.isString() && v.stringValue() == identifier) entitled = true;
  }
  if (!entitled)
    return QRVFail(error, QRV_ERROR(QRVResultCode::kNotEntitled, "Not entitled to wipe container with identifier: {}",
                                    identifier));

  try {
    UnrestrictedScope widened(*this);
    QRVError step;
    QRVMetadataRef existing = createOrLookupContainerWithContainerIdentity(
        containerIdentity, /*createIfNecessary=*/false, /*transient=*/false, /*useLocking=*/true, &step);
    if (!existing) {
      if (!QRVContainerCache::isNotFoundError(step)) QRVLogError("Failed to lookup existing container to wipe-identifier: {}", identifier);
      return QRVFail(error, step);
    }
    QRVMetadataRef fresh = createOrLookupContainerWithContainerIdentity(containerIdentity, /*createIfNecessary=*/true,
                                                                        /*transient=*/true, /*useLocking=*/true, &step);
    if (!fresh) {
      QRVLogError("Failed to create transient container for wipe-identifier: {}", identifier);
      return QRVFail(error, step);
    }
    if (!replaceContainerIdentity(existing->containerIdentity(), fresh->containerIdentity(), /*preserveOldUUID=*/true,
                                  /*startDeletionThread=*/true, &step)) {
      QRVLogError("Failed replace operation during delete all content: {}", step.description());
      return QRVFail(error, step);
    }
    return true;
  } catch (...) {
    if (services_->globalConfiguration->isInternalImage()) QRVReportUncaughtException(std::current_exception());
    return QRVFail(error, QRV_ERROR(QRVResultCode::kException, "Got exception: {} : {}",
                                    QRVExceptionDescription(std::current_exception()), "(no call stack)"));
  }
}
