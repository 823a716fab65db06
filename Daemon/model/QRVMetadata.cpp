#include "model/QRVMetadata.h"

#include <vector>

#include "base/QRVLog.h"
#include "fs/QRVDictionaryAdditions.h"
#include "fs/QRVFileManager.h"
#include "fs/QRVOpenDirectory.h"
#include "model/QRVGlobalConfiguration.h"
#include "users/QRVUserIdentityCache.h"

namespace {

// A value as the log lines show it; "(null)" when absent.
std::string describe(const QRVPlist* value) { return value ? value->description() : "(null)"; }

bool isNumber(const QRVPlist* value) { return value && value->type() == QRVPlist::Type::UInteger; }

// Path components without empty ones and ".", so "/a//b/./c/" and "/a/b/c"
// compare equal. ".." is kept: such a path is compared as written.
std::vector<std::string> components(const std::string& path) {
  std::vector<std::string> result;
  size_t start = 0;
  while (start <= path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    std::string component = path.substr(start, end - start);
    if (!component.empty() && component != ".") result.push_back(std::move(component));
    start = end + 1;
  }
  return result;
}

std::string join(const std::vector<std::string>& parts, size_t count) {
  std::string path;
  for (size_t i = 0; i < count; i++) path += "/" + parts[i];
  return path.empty() ? "/" : path;
}

// The container directory of a metadata file, as the caller spelled it.
std::string directoryOf(const std::string& fileURL) {
  std::string path = QRVPathWithoutTrailingSlashes(fileURL);
  size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : QRVPathWithoutTrailingSlashes(path.substr(0, slash));
}

std::string appending(const std::string& directory, const std::string& name) {
  if (directory.empty() || directory.back() == '/') return directory + name;
  return directory + "/" + name;
}

// Whether `directory` lies where containers of `containerClass` live: its
// great-grandparent plus the class's relative directory is its parent. This
// catches a container that was moved into another class's tree.
bool classPathMatches(const std::string& directory, QRVContainerClass containerClass, std::string* expected,
                      std::string* parent) {
  std::vector<std::string> parts = components(directory);
  const char* relative = QRVContainerClassRelativeDirectory(containerClass);
  *parent = parts.empty() ? "/" : join(parts, parts.size() - 1);
  if (parts.size() < 3 || !relative) return false;
  std::vector<std::string> base(parts.begin(), parts.end() - 3);
  for (std::string& part : components(relative)) base.push_back(std::move(part));
  *expected = join(base, base.size());
  return *expected == *parent;
}

}  // namespace

QRVMetadataRef QRVMetadata::make(const QRVConcreteContainerIdentity& containerIdentity, QRVPlist info,
                                 std::string url, std::string userManagedAssetsDirName) {
  std::shared_ptr<QRVMetadata> m(new QRVMetadata());
  m->containerClass_ = containerIdentity.containerClass();
  m->userIdentity_ = containerIdentity.userIdentity();
  m->identifier_ = containerIdentity.identifier();
  m->uuid_ = *containerIdentity.uuid();
  m->info_ = std::move(info);
  m->url_ = std::move(url);
  m->userManagedAssetsDirName_ = std::move(userManagedAssetsDirName);
  return m;
}

template <typename Change>
QRVMetadataRef QRVMetadata::copyWith(Change change) const {
  std::shared_ptr<QRVMetadata> copy(new QRVMetadata(*this));
  change(*copy);
  return copy;
}

QRVMetadataRef QRVMetadata::withUUID(const QRVUUID& uuid) const {
  return copyWith([&](QRVMetadata& m) { m.uuid_ = uuid; });
}
QRVMetadataRef QRVMetadata::withURL(std::string url) const {
  return copyWith([&](QRVMetadata& m) { m.url_ = std::move(url); });
}
QRVMetadataRef QRVMetadata::withInfo(QRVPlist info) const {
  return copyWith([&](QRVMetadata& m) { m.info_ = std::move(info); });
}
QRVMetadataRef QRVMetadata::withUserManagedAssetsDirName(std::string name) const {
  return copyWith([&](QRVMetadata& m) { m.userManagedAssetsDirName_ = std::move(name); });
}
QRVMetadataRef QRVMetadata::withTransient(bool transient) const {
  return copyWith([&](QRVMetadata& m) { m.transient_ = transient; });
}
QRVMetadataRef QRVMetadata::withExisted(bool existed) const {
  return copyWith([&](QRVMetadata& m) { m.existed_ = existed; });
}
QRVMetadataRef QRVMetadata::withUserIdentity(QRVUserIdentityRef userIdentity) const {
  return copyWith([&](QRVMetadata& m) { m.userIdentity_ = std::move(userIdentity); });
}

std::string QRVMetadata::metadataFileURL() const { return appending(url_, kFileName); }

QRVConcreteContainerIdentityRef QRVMetadata::containerIdentity() const {
  return QRVConcreteContainerIdentity::containerIdentityWithUUID(uuid_, userIdentity_, identifier_, containerClass_,
                                                                 nullptr);
}

QRVPlist QRVMetadata::plist() const {
  QRVPlist dictionary = QRVPlist::dictionary();
  if (info_.isDictionary()) dictionary.set(kInfoKey, info_);
  dictionary.set(kContentClassKey, QRVPlist::uinteger(containerClass_));
  if (QRVUserIdentity::isUserIdentityRequiredForContainerClass(containerClass_) && userIdentity_)
    dictionary.set(kUserIdentityKey, userIdentity_->plist());
  dictionary.set(kIdentifierKey, QRVPlist::string(identifier_));
  dictionary.set(kUUIDKey, QRVPlist::string(uuid_.string()));
  dictionary.set(kVersionKey, QRVPlist::string(kVersion));
  if (!userManagedAssetsDirName_.empty())
    dictionary.set(kUserManagedAssetsDirNameKey, QRVPlist::string(userManagedAssetsDirName_));
  return dictionary;
}

std::string QRVMetadata::description() const {
  return fmt::format(
      "<QRVMetadata: {}; userIdentity = {}, uuid = {}, containerClass = {}, identifier = {}, info = {}, url = {}, "
      "userManagedAssetsDirName = {}>",
      static_cast<const void*>(this), userIdentity_ ? userIdentity_->description() : "(null)", uuid_.string(),
      containerClass_, identifier_, info_.isNone() ? "(null)" : info_.description(), url_.empty() ? "(null)" : url_,
      userManagedAssetsDirName_.empty() ? "(null)" : userManagedAssetsDirName_);
}

// ---- Writing ----

bool QRVMetadata::writeMetadataToDisk(QRVFileManager& fileManager, QRVGlobalConfiguration& configuration,
                                      QRVError* error) const {
  return writeMetadataToFileURL(metadataFileURL(), fileManager, configuration, error);
}

bool QRVMetadata::writeMetadataToFileURL(const std::string& fileURL, QRVFileManager& fileManager,
                                         QRVGlobalConfiguration& configuration, QRVError* error) const {
  if (QRVUserIdentity::isUserIdentityRequiredForContainerClass(containerClass_) && !userIdentity_)
    return QRVFail(
        error, QRV_ERROR(QRVResultCode::kFileNotWritten, "Failed to write metadata to URL {} : no user identity for {}",
                         fileURL, identifier_));
  QRVPlist dictionary = plist();
  // Named after the container, so concurrent writers of different containers
  // never share a temporary file.
  const std::string temporary =
      appending(configuration.stagingDirectoryURLForUserIdentity(userIdentity_, containerClass_),
                fmt::format("temp_metadata-{}.plist", uuid_.string()));
  QRVConcreteContainerIdentityRef identity = containerIdentity();
  QRVLogDebug("[{}] Writing metadata to [{}]: {} => {}", __func__, fileURL,
              identity ? identity->description() : "(null)", dictionary.description());

  QRVError writeError;
  if (!fileManager.writeFileAtURL(temporary, dictionary.toBinary(), 0644, &writeError))
    return QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileNotWritten, writeError,
                                               "Failed to write metadata dictionary to URL {} : {}:{}", temporary,
                                               writeError.domain(), static_cast<long>(writeError.code())));
  QRVError moveError;
  if (!fileManager.moveItemAtURL(temporary, fileURL, &moveError)) {
    // Nothing else will ever clear it up.
    QRVError removeError;
    if (!fileManager.removeFileAtURL(temporary, &removeError))
      QRVLogError("Failed to remove {}: {}", temporary, removeError.description());
    return QRVFail(error,
                   QRV_ERROR_UNDERLYING(QRVResultCode::kFileNotWritten, moveError,
                                        "Failed to move metadata from staging: {} to final: {}", temporary, fileURL));
  }
  return true;
}

// ---- Reading ----

QRVMetadataRef QRVMetadata::readAndValidateMetadataAtUrl(const std::string& url, const QRVUserIdentityRef& userIdentity,
                                                         bool checkClassPath, QRVFileManager& fileManager,
                                                         QRVUserIdentityCache& userIdentityCache, QRVError* error) {
  return readAndValidateMetadataAtFileUrl(appending(url, kFileName), userIdentity, checkClassPath, fileManager,
                                          userIdentityCache, error);
}

QRVMetadataRef QRVMetadata::readAndValidateMetadataAtFileUrl(const std::string& fileURL,
                                                             const QRVUserIdentityRef& userIdentity,
                                                             bool checkClassPath, QRVFileManager& fileManager,
                                                             QRVUserIdentityCache& userIdentityCache,
                                                             QRVError* error) {
  std::vector<uint8_t> bytes;
  QRVError readError;
  bool read = fileManager.readRegularFileAtURL(fileURL, kMaximumFileSize, &bytes, &readError);
  return readAndValidateMetadataAtFileUrl(fileURL, read, bytes, readError, userIdentity, checkClassPath,
                                          userIdentityCache, error);
}

QRVMetadataRef QRVMetadata::readAndValidateMetadataBelowDirectory(const QRVOpenDirectory& classDirectory,
                                                                  const std::string& containerName,
                                                                  const QRVUserIdentityRef& userIdentity,
                                                                  bool checkClassPath, QRVFileManager& fileManager,
                                                                  QRVUserIdentityCache& userIdentityCache,
                                                                  QRVError* error) {
  const std::string fileURL = appending(appending(classDirectory.url(), containerName), kFileName);
  std::vector<uint8_t> bytes;
  QRVError readError;
  bool read = fileManager.readRegularFileBelowDirectory(classDirectory, containerName, kFileName, kMaximumFileSize,
                                                        &bytes, &readError);
  return readAndValidateMetadataAtFileUrl(fileURL, read, bytes, readError, userIdentity, checkClassPath,
                                          userIdentityCache, error);
}

QRVMetadataRef QRVMetadata::readAndValidateMetadataAtFileUrl(const std::string& fileURL, bool read,
                                                             const std::vector<uint8_t>& bytes,
                                                             const QRVError& givenReadError,
                                                             const QRVUserIdentityRef& userIdentity,
                                                             bool checkClassPath,
                                                             QRVUserIdentityCache& userIdentityCache,
                                                             QRVError* error) {
  const std::string directory = directoryOf(fileURL);

  // 1. The file, whose root must be a dictionary.
  QRVError readError = givenReadError;
  std::optional<QRVPlist> parsed;
  if (read) {
    parsed = QRVPlist::fromBytes(bytes.data(), bytes.size());
    if (!parsed || !parsed->isDictionary()) {
      readError = QRVError::make(QRVError::kGeneralDomain, 2048, __func__, __LINE__, -1,
                                 fmt::format("The file {} is not a property-list dictionary", fileURL));
      parsed.reset();
    }
  }
  if (!parsed) {
    QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kFileUnreadable, readError, "Failed to read metadata at URL {}",
                                        directory));
    return nullptr;
  }
  QRVPlist dictionary = std::move(*parsed);

  // 2. Identifier.
  const QRVPlist* identifierValue = dictionary.get(kIdentifierKey);
  if (!identifierValue || !identifierValue->isString()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidFileContent, "Invalid metadata Identifier: {} at {}",
                             describe(identifierValue), directory));
    return nullptr;
  }
  const std::string identifier = identifierValue->stringValue();

  // 3. UUID.
  const QRVPlist* uuidValue = dictionary.get(kUUIDKey);
  if (!uuidValue || !uuidValue->isString()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidFileContent, "Invalid metadata UUID String: {} at {}",
                             describe(uuidValue), directory));
    return nullptr;
  }
  std::optional<QRVUUID> uuid = QRVUUID::fromString(uuidValue->stringValue());
  if (!uuid) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidFileContent, "Invalid metadata UUID: {} at {}",
                             uuidValue->stringValue(), directory));
    return nullptr;
  }

  // 4. Class.
  const QRVPlist* classValue = dictionary.get(kContentClassKey);
  if (!isNumber(classValue)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidFileContent, "Invalid metadata Class: {} at {}",
                             describe(classValue), directory));
    return nullptr;
  }
  const QRVContainerClass containerClass = classValue->uint64Value();
  if (!QRVContainerClassIsValid(containerClass)) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidFileContent, "Invalid metadata Content Class: {} at {}",
                             static_cast<long>(containerClass), directory));
    return nullptr;
  }

  // 5. User identity.
  QRVUserIdentityRef owner;
  if (!QRVUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
    owner = userIdentityCache.defaultUserIdentity();
  } else {
    if (!userIdentity) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidFileContent,
                               "Incorrect User Identity: {}, expecting: (null) for {} at {}: {}",
                               describe(dictionary.get(kUserIdentityKey)), identifier, directory, 0));
      return nullptr;
    }
    const uid_t expectedUID = userIdentity->posixUIDForContainerClass(containerClass);
    // 5a. The uid older files recorded must be the expected owner's; files
    // without one are taken to be the expected owner's.
    if (QRVContainerClassIsPerUser(containerClass)) {
      const QRVPlist* persona = dictionary.get(kPersonaKey);
      if (persona) {
        if (!isNumber(persona) || persona->uint64Value() != expectedUID) {
          QRVFail(error,
                  QRV_ERROR(QRVResultCode::kInvalidFileContent, "Incorrect UserId: {}, expecting: {} for {} at {}",
                            describe(persona), expectedUID, identifier, directory));
          return nullptr;
        }
      } else {
        dictionary.set(kPersonaKey, QRVPlist::uinteger(expectedUID));
      }
    }
    const QRVPlist* stored = dictionary.get(kUserIdentityKey);
    if (stored) {
      // 5b. The stored identity must be the expected one.
      QRVError identityError;
      owner = QRVUserIdentity::userIdentityWithPlist(*stored, userIdentityCache, &identityError);
      if (!owner) {
        QRVFail(error, QRV_ERROR_UNDERLYING(QRVResultCode::kInvalidFileContent, identityError,
                                            "Invalid metadata User Identity: {} for {} at {}: {}",
                                            stored->description(), identifier, directory, identityError.code()));
        return nullptr;
      }
      if (!owner->isEqualToUserIdentity(*userIdentity)) {
        QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidFileContent,
                                 "Incorrect User Identity: {}, expecting: {} for {} at {}: {}", owner->description(),
                                 userIdentity->description(), identifier, directory, identityError.code()));
        return nullptr;
      }
    } else {
      // 5c. A file from before user identities were stored: the personal
      // persona of the recorded uid.
      const QRVPlist* persona = dictionary.get(kPersonaKey);
      if (isNumber(persona) && persona->uint64Value() <= UINT32_MAX) {
        auto uid = static_cast<uid_t>(_uidForLegacyPersonaValue(persona->uint64Value()));
        owner = userIdentityCache.userIdentityForPersonalPersonaWithUID(uid, uid);
      }
      if (!owner) {
        QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidFileContent, "Could not create user identity from {}: {}",
                                 describe(persona), 1));
        return nullptr;
      }
    }
  }

  // 6. Info.
  const QRVPlist* info = dictionary.get(kInfoKey);
  if (info && !info->isDictionary()) {
    QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidFileContent, "Invalid metadata Info: {} at {}", info->description(),
                             directory));
    return nullptr;
  }

  // 7. Name of the user-managed assets directory.
  const QRVPlist* assets = dictionary.get(kUserManagedAssetsDirNameKey);
  if (assets && !assets->isString()) {
    QRVFail(error,
            QRV_ERROR(QRVResultCode::kInvalidFileContent, "Invalid metadata User Managed Dir Name String: {} at {}",
                      assets->description(), directory));
    return nullptr;
  }

  // 8. The directory must lie in its class's tree.
  if (checkClassPath) {
    std::string expected, parent;
    if (!classPathMatches(directory, containerClass, &expected, &parent)) {
      QRVFail(error, QRV_ERROR(QRVResultCode::kInvalidFileContent, "Invalid metadata-URLs should match: {} : {}",
                               expected, parent));
      return nullptr;
    }
  }

  // 9. The value.
  QRVConcreteContainerIdentityRef identity =
      QRVConcreteContainerIdentity::containerIdentityWithUUID(*uuid, owner, identifier, containerClass, error);
  if (!identity) return nullptr;
  QRVMetadataRef metadata = make(*identity, info ? *info : QRVPlist(), directory,
                                 assets ? assets->stringValue() : std::string());
  QRVLogDebug("[{}] Read metadata from [{}]: {} <= {}", __func__, fileURL, identity->description(),
              dictionary.description());
  return metadata;
}
