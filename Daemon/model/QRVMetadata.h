// A container's identity card: the hidden property-list file
// ".com.kelva.quorva.metadata.plist" directly inside every container
// directory, and its in-memory form. The file says which identifier, class,
// user identity and UUID the directory belongs to, plus a free-form info
// dictionary and the name of the user-managed assets directory. The container
// cache rebuilds its picture of the disk from these files alone, so a
// directory without a valid file is not a container.
//
// A QRVMetadata is an immutable value shared by reference; the "with" methods
// return changed copies. Safe to share between threads.
//
// Files are hostile input: a container directory belongs to its user, who
// can replace the file with anything. Reading refuses links, non-regular
// files and oversized files, and validates every field before it is used.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "base/QRVError.h"
#include "base/QRVPlist.h"
#include "base/QRVUUID.h"
#include "model/QRVContainerClass.h"
#include "model/QRVContainerIdentity.h"
#include "model/QRVUserIdentity.h"

class QRVFileManager;
class QRVOpenDirectory;
class QRVGlobalConfiguration;
class QRVUserIdentityCache;
class QRVMetadata;
using QRVMetadataRef = std::shared_ptr<const QRVMetadata>;

class QRVMetadata {
 public:
  static constexpr const char* kFileName = ".com.kelva.quorva.metadata.plist";
  static constexpr const char* kIdentifierKey = "QRVMetadataIdentifier";
  static constexpr const char* kUUIDKey = "QRVMetadataUUID";
  static constexpr const char* kContentClassKey = "QRVMetadataContentClass";
  static constexpr const char* kUserIdentityKey = "QRVMetadataUserIdentity";
  static constexpr const char* kVersionKey = "QRVMetadataVersion";
  static constexpr const char* kInfoKey = "QRVMetadataInfo";
  static constexpr const char* kUserManagedAssetsDirNameKey = "QRVMetadataUserManagedAssetsDirName";
  // Written by older versions only: the owner's uid, used when the user
  // identity is absent.
  static constexpr const char* kPersonaKey = "QRVMetadataPersona";
  static constexpr const char* kVersion = "2";

  // Codes of this component: QRVResultCode::kFileUnreadable when the file
  // cannot be read, kInvalidFileContent when it does not describe a valid
  // container, kFileNotWritten when it cannot be written.

  // The file is a few hundred bytes plus the info values, which arrive in
  // client messages of at most 16 MiB; anything larger is not ours.
  static constexpr size_t kMaximumFileSize = 32 * 1024 * 1024;

  // Copies class, user identity, identifier and UUID from `containerIdentity`
  // (which must not be null). `info` is a dictionary or none; `url` the
  // container directory; an empty assets name means none.
  static QRVMetadataRef make(const QRVConcreteContainerIdentity& containerIdentity, QRVPlist info, std::string url,
                             std::string userManagedAssetsDirName);

  // Writes the file into the container directory `url()`.
  bool writeMetadataToDisk(QRVFileManager& fileManager, QRVGlobalConfiguration& configuration,
                           QRVError* error) const;
  // Writes the file as a binary property list to `fileURL`: to a temporary
  // file in the staging directory of the class and user, flushed to disk,
  // then moved over the target (which flushes the target's directory). A
  // crash leaves the old file or the new one, never a torn one. No
  // data-protection class is set, so the file stays readable while the device
  // is locked. Fails with 34; a temporary file left by a failed move is
  // removed.
  bool writeMetadataToFileURL(const std::string& fileURL, QRVFileManager& fileManager,
                              QRVGlobalConfiguration& configuration, QRVError* error) const;

  // Reads the file inside the container directory `url` and validates it for
  // `userIdentity`, the identity the caller expects to own it (ignored for
  // bundle and system classes, which get the cache's default identity). With
  // `checkClassPath`, the directory must also lie where containers of its
  // class live relative to its grandparents. Fails with 12 (unreadable, or
  // its root is not a dictionary) or 29 (a field missing, of the wrong type,
  // or not what the caller expects); the disk is never changed.
  static QRVMetadataRef readAndValidateMetadataAtUrl(const std::string& url, const QRVUserIdentityRef& userIdentity,
                                                     bool checkClassPath, QRVFileManager& fileManager,
                                                     QRVUserIdentityCache& userIdentityCache, QRVError* error);
  // The same given the file's own path; the container directory is its
  // parent.
  static QRVMetadataRef readAndValidateMetadataAtFileUrl(const std::string& fileURL,
                                                         const QRVUserIdentityRef& userIdentity, bool checkClassPath,
                                                         QRVFileManager& fileManager,
                                                         QRVUserIdentityCache& userIdentityCache, QRVError* error);

  // The same for the container directory `containerName` of an open class
  // directory, its file read below the descriptor without following a link
  // (QRVFileManager::readRegularFileBelowDirectory): the checks, errors and
  // log lines of readAndValidateMetadataAtUrl on the same directory.
  static QRVMetadataRef readAndValidateMetadataBelowDirectory(const QRVOpenDirectory& classDirectory,
                                                              const std::string& containerName,
                                                              const QRVUserIdentityRef& userIdentity,
                                                              bool checkClassPath, QRVFileManager& fileManager,
                                                              QRVUserIdentityCache& userIdentityCache,
                                                              QRVError* error);

  // The uid an older file's "QRVMetadataPersona" value stands for: 499 is
  // read as uid 0, deliberately, so that such files read as they always did.
  static uint64_t _uidForLegacyPersonaValue(uint64_t value) { return value == 499 ? 0 : value; }

  // Not stored in the file: set by whoever found or made the container.
  bool transient() const { return transient_; }
  bool existed() const { return existed_; }
  QRVContainerClass containerClass() const { return containerClass_; }
  const QRVUserIdentityRef& userIdentity() const { return userIdentity_; }
  const std::string& identifier() const { return identifier_; }
  const QRVUUID& uuid() const { return uuid_; }
  const std::string& url() const { return url_; }
  const std::string& userManagedAssetsDirName() const { return userManagedAssetsDirName_; }
  // A dictionary, or none when the container has no info values.
  const QRVPlist& info() const { return info_; }
  // url() + the file name.
  std::string metadataFileURL() const;

  // The concrete identity of this container; null only for a value whose
  // fields were never valid (logged).
  QRVConcreteContainerIdentityRef containerIdentity() const;

  // Changed copies.
  QRVMetadataRef withUUID(const QRVUUID& uuid) const;
  QRVMetadataRef withURL(std::string url) const;
  QRVMetadataRef withInfo(QRVPlist info) const;
  QRVMetadataRef withUserManagedAssetsDirName(std::string name) const;
  QRVMetadataRef withTransient(bool transient) const;
  QRVMetadataRef withExisted(bool existed) const;
  QRVMetadataRef withUserIdentity(QRVUserIdentityRef userIdentity) const;

  // The dictionary the file holds for this value.
  QRVPlist plist() const;
  std::string description() const;

 private:
  QRVMetadata() = default;
  template <typename Change>
  QRVMetadataRef copyWith(Change change) const;
  // The validation of the readers, given what reading `fileURL` gave: the
  // bytes when `read`, otherwise the read's error. Named like the reader so
  // that its errors and log lines name the function they always named,
  // whichever way the file was read.
  static QRVMetadataRef readAndValidateMetadataAtFileUrl(const std::string& fileURL, bool read,
                                                         const std::vector<uint8_t>& bytes, const QRVError& readError,
                                                         const QRVUserIdentityRef& userIdentity, bool checkClassPath,
                                                         QRVUserIdentityCache& userIdentityCache, QRVError* error);

  bool transient_ = false;
  bool existed_ = false;
  QRVContainerClass containerClass_ = QRVContainerClassUndefined;
  QRVUserIdentityRef userIdentity_;
  std::string identifier_;
  QRVUUID uuid_;
  std::string url_;
  std::string userManagedAssetsDirName_;
  QRVPlist info_;
};
