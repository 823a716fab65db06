#include "fs/QRVPathComponents.h"

namespace QRVPathComponents {

std::vector<std::string> split(std::string_view path) {
  std::vector<std::string> components;
  if (!path.empty() && path.front() == '/') components.emplace_back("/");
  size_t start = 0;
  while (start < path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string_view::npos) end = path.size();
    if (end > start) components.emplace_back(path.substr(start, end - start));
    start = end + 1;
  }
  return components;
}

std::string join(const std::vector<std::string>& components, size_t begin, size_t end) {
  std::string path;
  for (size_t i = begin; i < end; i++) {
    if (components[i] == "/") {
      path = "/";
      continue;
    }
    if (!path.empty() && path.back() != '/') path += '/';
    path += components[i];
  }
  return path;
}

std::string deletingLast(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  size_t slash = path.rfind('/');
  if (slash == std::string::npos) return "";
  return slash == 0 ? "/" : path.substr(0, slash);
}

std::string parentDirectory(const std::string& path) {
  std::string parent = deletingLast(path);
  return parent.empty() ? "." : parent;
}

std::string appending(const std::string& path, const std::string& component) {
  if (path.empty()) return component;
  if (path.back() == '/') return path + component;
  return path + "/" + component;
}

std::string last(const std::string& path) {
  std::vector<std::string> components = split(path);
  return components.empty() ? "" : components.back();
}

std::string withoutPrivatePrefix(const std::string& path) {
  return path.rfind("/private/", 0) == 0 ? path.substr(8) : path;
}

}  // namespace QRVPathComponents
