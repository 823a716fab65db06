// The daemon's one gateway to the file system. Every failure is an error of
// the POSIX domain whose code is the errno.
//
// Only what start-up needs so far is here; the rest of the file operations
// join it as the container operations arrive.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

#include "QRVError.h"

class QRVFileManager {
 public:
  // Creates `path` with `mode` (and its missing parents when
  // `withIntermediateDirectories`, mode 0755). An existing directory is
  // success.
  bool createDirectoryAtURL(const std::string& path, bool withIntermediateDirectories, mode_t mode,
                            QRVError* error);

  // Reads a whole file. Fails with the errno of the failing call.
  bool readFileAtURL(const std::string& path, std::vector<uint8_t>* contents, QRVError* error);
  // Replaces `path` with `contents`: written to a temporary file beside it,
  // flushed to disk, renamed over the target, and the directory flushed, so
  // that after a crash the file holds either the old or the new contents.
  bool writeFileAtomically(const std::string& path, const std::vector<uint8_t>& contents, mode_t mode,
                           QRVError* error);
  // Removes a file; a missing file is success.
  bool removeFileAtURL(const std::string& path, QRVError* error);
};
