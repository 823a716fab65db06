#include "fs/QRVDictionaryAdditions.h"

#include <vector>

bool QRV_writeToURL(QRVFileManager& fileManager, const QRVPlist& dictionary, const std::string& path,
                    QRVError* error) {
  return fileManager.writeFileAtomically(path, dictionary.toBinary(), 0644, error);
}

std::optional<QRVPlist> QRV_dictionaryWithContentsOfURL(QRVFileManager& fileManager, const std::string& path,
                                                        QRVError* error) {
  std::vector<uint8_t> bytes;
  if (!fileManager.readFileAtURL(path, &bytes, error)) return std::nullopt;
  std::optional<QRVPlist> plist = QRVPlist::fromBytes(bytes.data(), bytes.size());
  if (!plist || !plist->isDictionary()) {
    QRVFail(error, QRVError::make(QRVError::kGeneralDomain, 2048, __func__, __LINE__, -1,
                                  fmt::format("The file {} is not a property-list dictionary", path)));
    return std::nullopt;
  }
  return plist;
}

std::string QRVPathByAppendingComponent(const std::string& directory, const std::string& component) {
  if (directory.empty()) return component;
  return directory.back() == '/' ? directory + component : directory + "/" + component;
}

std::string QRVPathWithoutTrailingSlashes(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

std::string QRVLastPathComponent(const std::string& path) {
  std::string p = QRVPathWithoutTrailingSlashes(path);
  size_t slash = p.rfind('/');
  return slash == std::string::npos ? p : p.substr(slash + 1);
}

bool QRVContainsDotDotPathComponents(std::string_view path) {
  size_t start = 0;
  while (start <= path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string_view::npos) end = path.size();
    if (path.substr(start, end - start) == "..") return true;
    start = end + 1;
  }
  return false;
}
