#include "core/QRVBundleExecutable.h"

#include "base/QRVLog.h"
#include "fs/QRVDictionaryAdditions.h"
#include "model/QRVMetadata.h"

namespace {

constexpr QRVContainerClass kBundleClasses[] = {QRVContainerClassAppBundle, QRVContainerClassPluginBundle,
                                                QRVContainerClassVPNPluginBundle};

// Absolute, and every component a plain name: what the kernel reports for a
// running program. Anything else is not trusted to compare by prefix.
bool isCanonicalAbsolutePath(const std::string& path) {
  if (path.size() < 2 || path.front() != '/' || path.back() == '/') return false;
  size_t start = 1;
  while (start <= path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    std::string_view component(path.data() + start, end - start);
    if (component.empty() || component == "." || component == "..") return false;
    start = end + 1;
  }
  return path.find('\0') == std::string::npos;
}

}  // namespace

std::optional<std::string> QRVBundleExecutable::_containerNameBelow(const std::string& directory,
                                                                    const std::string& path) {
  if (path.size() <= directory.size() + 1 || path.compare(0, directory.size(), directory) != 0 ||
      path[directory.size()] != '/')
    return std::nullopt;
  size_t nameStart = directory.size() + 1;
  size_t slash = path.find('/', nameStart);
  // The executable must lie inside the container, not be its directory.
  if (slash == std::string::npos || slash == nameStart || slash + 1 >= path.size()) return std::nullopt;
  return path.substr(nameStart, slash - nameStart);
}

std::optional<QRVBundleExecutable::Owner> QRVBundleExecutable::ownerOfExecutablePath(const std::string& path,
                                                                                     QRVServices& services) {
  if (!isCanonicalAbsolutePath(path)) {
    QRVLogDebug("Executable path {} is not canonical; not a bundle program", path);
    return std::nullopt;
  }
  QRVUserIdentityRef defaultUser = services.userIdentityCache->defaultUserIdentity();
  for (QRVContainerClass containerClass : kBundleClasses) {
    std::optional<std::string> classDirectory =
        services.globalConfiguration->containerDirectoryURLForUserIdentity(defaultUser, containerClass,
                                                                           /*transient=*/false);
    if (!classDirectory) continue;
    // The kernel's path is resolved; compare it with the resolved class
    // directory (the root may itself lie behind a link).
    std::optional<std::string> realClassDirectory =
        services.fileManager->realPathForURL(*classDirectory, *classDirectory);
    if (!realClassDirectory) continue;
    std::optional<std::string> name = _containerNameBelow(QRVPathWithoutTrailingSlashes(*realClassDirectory), path);
    if (!name) continue;

    const std::string containerURL = QRVPathByAppendingComponent(*classDirectory, *name);
    QRVError error;
    QRVMetadataRef metadata = QRVMetadata::readAndValidateMetadataAtUrl(
        containerURL, defaultUser, /*checkClassPath=*/true, *services.fileManager, *services.userIdentityCache, &error);
    if (!metadata || metadata->containerClass() != containerClass || !metadata->containerIdentity()) {
      QRVLogDebug("No bundle container of class {} at {}: {}", containerClass, containerURL, error.description());
      return std::nullopt;
    }
    QRVMetadataRef known =
        services.containerCache->containerForContainerIdentity(*metadata->containerIdentity(), &error);
    if (!known || known->uuid() != metadata->uuid() ||
        QRVPathWithoutTrailingSlashes(known->url()) != QRVPathWithoutTrailingSlashes(containerURL)) {
      QRVLogError("Executable {} lies in {}, which is not the container of {}", path, containerURL,
                  metadata->identifier());
      return std::nullopt;
    }
    return Owner{metadata->identifier(), containerClass};
  }
  return std::nullopt;
}
