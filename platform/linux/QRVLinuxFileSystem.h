// The file-system calls on Linux: each method is the system call or libc
// function it is named after, with errno returned instead of set.
#pragma once

#include "platform/QRVFileSystem.h"

class QRVLinuxFileSystem : public QRVFileSystem {
 public:
  int open(int directoryFD, const std::string& path, int flags, mode_t mode, int* fd) override;
  int openResolved(int directoryFD, const std::string& path, int flags, uint64_t resolve, int* fd) override;
  int close(int fd) override;
  int makeDirectory(int directoryFD, const std::string& path, mode_t mode) override;
  int makeTemporaryDirectory(std::string* pathTemplate) override;
  int makeTemporaryFile(std::string* pathTemplate, int flags, int* fd) override;
  int rename(int fromDirectoryFD, const std::string& from, int toDirectoryFD, const std::string& to,
             unsigned flags) override;
  int unlink(int directoryFD, const std::string& path, int flags) override;
  int changeOwner(int directoryFD, const std::string& path, uid_t uid, gid_t gid, int flags) override;
  int changeOwnerOfFD(int fd, uid_t uid, gid_t gid) override;
  int changeMode(int directoryFD, const std::string& path, mode_t mode, int flags) override;
  int changeModeOfFD(int fd, mode_t mode) override;
  int status(int directoryFD, const std::string& path, struct stat* st, int flags) override;
  int statusOfFD(int fd, struct stat* st) override;
  int synchronize(int fd) override;
  int synchronizeFileSystem(int fd) override;
  int readLink(int directoryFD, const std::string& path, std::string* target) override;
  int realPath(const std::string& path, std::string* resolved) override;
  int readDirectory(int fd, std::vector<DirectoryEntry>* entries) override;
  int read(int fd, void* buffer, size_t size, size_t* done) override;
  int write(int fd, const void* buffer, size_t size, size_t* done) override;
};
