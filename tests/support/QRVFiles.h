// Small file helpers for tests that look at what the daemon left on disk.
#pragma once

#include <cstddef>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
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

// A tree as a test sees it: relative path -> what it found there.
using QRVListing = std::map<std::string, std::string>;

// The entries of two listings that differ, one per line ("gone: ",
// "changed: ", "new: " and the path), for a readable failure.
inline std::string QRVListingDifferences(const QRVListing& before, const QRVListing& after) {
  std::string out;
  for (const auto& [path, entry] : before) {
    auto it = after.find(path);
    if (it == after.end())
      out += "gone: " + path + "\n";
    else if (it->second != entry)
      out += "changed: " + path + "\n";
  }
  for (const auto& [path, entry] : after)
    if (!before.count(path)) out += "new: " + path + "\n";
  return out;
}
