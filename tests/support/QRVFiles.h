// Small file helpers for tests that look at what the daemon left on disk.
#pragma once

#include <cstddef>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

inline void QRVWriteText(const std::string& path, const std::string& text) { std::ofstream(path) << text; }

inline std::string QRVReadText(const std::string& path) {
  std::ifstream in(path);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

// Entries directly inside `dir`; 0 when it does not exist.
inline size_t QRVEntriesIn(const std::string& dir) {
  std::error_code ec;
  if (!std::filesystem::exists(dir, ec)) return 0;
  return std::distance(std::filesystem::directory_iterator(dir), std::filesystem::directory_iterator());
}
