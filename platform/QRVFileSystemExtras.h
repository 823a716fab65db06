// File-system services beyond POSIX: data-protection classes, the immutable
// flag, group ACLs, cloning copies, directory statistics and the default
// subdirectories of a container class.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "QRVError.h"

class QRVFileSystemExtras {
 public:
  struct DirectoryStatistics {
    uint64_t allocatedBytes = 0;
    uint64_t entries = 0;
  };

  virtual ~QRVFileSystemExtras() = default;

  virtual bool getProtectionClass(const std::string& path, uint32_t* protectionClass, QRVError* error) = 0;
  virtual bool setProtectionClass(const std::string& path, uint32_t protectionClass, QRVError* error) = 0;
  virtual bool getImmutable(const std::string& path, bool* immutable, QRVError* error) = 0;
  virtual bool setImmutable(const std::string& path, bool immutable, QRVError* error) = 0;
  // Grants the group `groupName` the rights of a system container on `path`.
  virtual bool setSystemContainerACL(const std::string& path, const std::string& groupName,
                                     bool isDirectory, QRVError* error) = 0;
  virtual bool cloneFile(const std::string& from, const std::string& to, QRVError* error) = 0;
  virtual bool directoryStatistics(const std::string& path, bool fast, DirectoryStatistics* stats,
                                   QRVError* error) = 0;
  virtual std::vector<std::string> defaultSubdirectories(uint64_t containerClass) = 0;
};
