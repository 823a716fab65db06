// Property-list files and path strings, as the whole daemon uses them.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "base/QRVError.h"
#include "base/QRVPlist.h"
#include "fs/QRVFileManager.h"

// Writes `dictionary` as a binary property list to `path`, always
// atomically: to a temporary file renamed over the target, with the file and
// its directory flushed, so that a crash leaves the old or the new file and
// never a torn one. No caller wants anything else.
bool QRV_writeToURL(QRVFileManager& fileManager, const QRVPlist& dictionary, const std::string& path,
                    QRVError* error);

// Reads a property-list file (binary or XML) whose root must be a
// dictionary; otherwise fails with 2048 in the general domain. A file that
// cannot be read fails with its errno.
std::optional<QRVPlist> QRV_dictionaryWithContentsOfURL(QRVFileManager& fileManager, const std::string& path,
                                                        QRVError* error);

// `directory` + "/" + `component`, without doubling a trailing slash.
std::string QRVPathByAppendingComponent(const std::string& directory, const std::string& component);
// The last component of `path`, ignoring trailing slashes.
std::string QRVLastPathComponent(const std::string& path);
// `path` without trailing slashes ("/" stays "/").
std::string QRVPathWithoutTrailingSlashes(std::string path);

// True when a component of `path` is exactly "..": such a relative path
// could climb out of the directory it is meant for.
bool QRVContainsDotDotPathComponents(std::string_view path);
