// Changes the data-protection class of everything inside one data container
// (its app user-data items), surviving both a locked device and a restart.
//
// Before the change starts, the caller writes the operation to an update file
// in the pending-updates directory (writeToDiskWithError: binary property
// list, atomic and flushed to disk with its directory, so that it survives a
// power loss and can be read while the device is locked). The file is named
// after the container (identifier, class, user identity), so a newer change
// of the same container replaces it; each change carries a random internal
// identifier, and an operation whose identifier is no longer the file's has
// been superseded: its next pass fails with 69 and it never deletes the file.
// At start-up every file left behind becomes an operation again
// (dataProtectionChangeOperationAtURL).
//
// A pass runs under the container's identifier lock (write, keyed by its UUID
// string), so that it never races a deletion or replacement. It walks the
// items without following any link (an application may plant links to
// anything), to any depth, and sets classes on the open descriptors. Setting
// a class fails with EPERM while the device is locked: with retryIfLocked the
// operation is queued on the lock-state queue (suspended while locked) inside
// a keep-alive transaction and runs again after the next unlock; without it,
// it ends with 61.
//
// Thread-safety: the update file is touched only on `queue`, synchronously.
// performChangeOperation may run on any thread but not twice at once for one
// operation (retries are serialised by the lock-state queue). Set the blocks
// before performChangeOperation.
//
// Lock order: a container's identifier lock, then `queue`. Nothing running
// on `queue` may take an identifier lock or look a container up.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "base/QRVError.h"
#include "base/QRVSerialQueue.h"
#include "base/QRVUUID.h"
#include "core/QRVServices.h"
#include "model/QRVContainerIdentity.h"
#include "model/QRVMetadata.h"

// What an update file says, checked and with its user identity resolved.
struct QRVDataProtectionUpdate {
  std::string identifier;
  QRVContainerClass containerClass = 0;
  QRVUserIdentityRef userIdentity;  // null for a class that needs none
  int32_t protectionClass = 0;
  uint32_t changeType = 0;
  bool retryIfLocked = false;
  QRVUUID internalChangeID;
};

class QRVDataProtectionChangeOperation : public std::enable_shared_from_this<QRVDataProtectionChangeOperation> {
 public:
  // Bits of changeType.
  static constexpr uint32_t kChangeDirectories = 1;
  static constexpr uint32_t kChangeFiles = 2;
  static constexpr uint32_t kNeverRaiseFileClass = 4;

  // Keys of the update file.
  static constexpr const char* kIdentifierKey = "QRVDataOperationIdentifier";
  static constexpr const char* kContainerClassKey = "QRVDataOperationContainerClass";
  static constexpr const char* kProtectionClassKey = "QRVDataOperationProtectionClass";
  static constexpr const char* kChangeTypeKey = "QRVDataOperationChangeType";
  static constexpr const char* kRetryIfLockedKey = "QRVDataOperationRetryIfLocked";
  static constexpr const char* kInternalIDKey = "QRVDataOperationInternalID";
  static constexpr const char* kUserIdentityKey = "QRVDataOperationUserIdentity";
  static constexpr const char* kUserIdKey = "QRVDataOperationUserId";  // read, never written

  // `error` is null on success.
  using CompletionBlock = std::function<void(bool needToRetry, const QRVError* error)>;
  using RetryStartBlock = std::function<void()>;

  // The services stand for the user identity cache (its
  // userIdentityCache), the file manager, the configuration, the lock-state
  // queue and the keep-alive transactions. The first form draws a random
  // internal change identifier.
  static std::shared_ptr<QRVDataProtectionChangeOperation> initWithContainerMetadata(
      QRVMetadataRef metadata, int32_t newClass, bool retryingIfLocked, uint32_t changeType,
      std::shared_ptr<QRVSerialQueue> queue, std::shared_ptr<QRVServices> services);
  static std::shared_ptr<QRVDataProtectionChangeOperation> initWithContainerMetadata(
      QRVMetadataRef metadata, int32_t newClass, bool retryingIfLocked, uint32_t changeType,
      const QRVUUID& internalChangeID, std::shared_ptr<QRVSerialQueue> queue, std::shared_ptr<QRVServices> services);

  const QRVMetadataRef& dataContainerMetadata() const { return metadata_; }
  int32_t newDataProtectionClass() const { return newClass_; }
  uint32_t changeType() const { return changeType_; }
  bool retryIfLocked() const { return retryIfLocked_; }
  const QRVUUID& internalChangeID() const { return internalChangeID_; }
  bool retried() const { return retried_.load(); }
  // Called once, when the operation ends without a pending retry.
  void setCompletionBlock(CompletionBlock block) { completionBlock_ = std::move(block); }
  // Called once, before the first retry runs.
  void setRetryStartBlock(RetryStartBlock block) { retryStartBlock_ = std::move(block); }

  // The update file of this operation, at its URL. Codes: 38 (no metadata or
  // change type 0), 36 (an existing file could not be removed), 34.
  bool writeToDiskWithError(QRVError* error);
  // Deletes the update file when it is still this operation's; a newer
  // change's file is left alone (success, logged).
  bool _deleteUpdateFileWithError(QRVError* error);
  // Whether the update file at this operation's URL carries its internal
  // change identifier.
  bool _stillMostCurrentUpdate();

  // Runs a pass, then either queues the retry (locked, retryIfLocked) or
  // deletes the update file and calls the completion block.
  void performChangeOperation();
  // One pass over the container, under its identifier lock. On success
  // `*needToRetry` tells whether the device was found locked. Codes: 21 (the
  // container is gone), 10 (its path changed), 69 (superseded), 40 (an
  // exception), or the POSIX error that ended the walk.
  bool _runChangeOperationNeedToRetry(bool* needToRetry, QRVError* error);

  // Where the update file of `containerIdentity` lives.
  static std::string urlForProtectionOperationWithContainerIdentity(const QRVContainerIdentity& containerIdentity,
                                                                    QRVServices& services);
  // Removes the update file of `containerIdentity`; a missing file is
  // success. Code 36.
  static bool deleteUpdateFileWithContainerIdentity(const QRVContainerIdentity& containerIdentity,
                                                    QRVServices& services, QRVError* error);
  // Reads and checks the update file at `url`. Codes: 38 (no URL), 12
  // (unreadable, or not a dictionary), 29 (a value missing, of the wrong type
  // or out of range, or an identifier that is not a single file name).
  static std::optional<QRVDataProtectionUpdate> _readAndValidateDataProtectionUpdateAtURL(const std::string& url,
                                                                                          QRVServices& services,
                                                                                          QRVError* error);
  // The operation an update file left behind describes. The file is read on
  // `queue`; the container is looked up after leaving it. Never call this on
  // `queue`: the look-up takes identifier locks, and a pass holding one waits
  // for `queue`. The file must lie where the container it names keeps its
  // update file (29 otherwise: a file this daemon did not write). Codes:
  // those of the read, 29, 21 (the container is gone).
  static std::shared_ptr<QRVDataProtectionChangeOperation> dataProtectionChangeOperationAtURL(
      const std::string& url, std::shared_ptr<QRVSerialQueue> queue, std::shared_ptr<QRVServices> services,
      QRVError* error);

  // Use initWithContainerMetadata.
  QRVDataProtectionChangeOperation(QRVMetadataRef metadata, int32_t newClass, bool retryingIfLocked,
                                   uint32_t changeType, const QRVUUID& internalChangeID,
                                   std::shared_ptr<QRVSerialQueue> queue, std::shared_ptr<QRVServices> services);

 private:
  bool _onQueue_writeToDiskWithError(QRVError* error);
  bool _onQueue_deleteUpdateFileWithError(QRVError* error);
  bool _onQueue_stillMostCurrentUpdate();
  bool _lockedPass(bool* needToRetry, QRVError* error);
  // Sets the classes below one item; false with the error that ended the
  // walk.
  bool _changeItemAtURL(const std::string& itemURL, QRVError* error);
  std::string _url() const;
  std::string _userDescription() const;

  const QRVMetadataRef metadata_;
  const int32_t newClass_;
  const bool retryIfLocked_;
  const uint32_t changeType_;
  const QRVUUID internalChangeID_;
  const std::shared_ptr<QRVSerialQueue> queue_;
  const std::shared_ptr<QRVServices> services_;
  std::atomic<bool> retried_{false};
  CompletionBlock completionBlock_;
  RetryStartBlock retryStartBlock_;
};
