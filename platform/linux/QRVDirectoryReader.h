// Reading every entry of an open directory descriptor.
#pragma once

#include <dirent.h>

#include <functional>

// Calls `visit` with each entry of the open directory `fd` other than "."
// and "..". The directory is read through a description of its own, so
// `fd`'s read position is neither used nor moved and `fd` stays usable for
// openat and fstatat meanwhile (even from inside `visit`). Stops at the first
// non-zero value `visit` returns and returns it; otherwise returns 0, or the
// errno of an open or read that failed.
int QRVForEachDirectoryEntry(int fd, const std::function<int(const dirent& entry)>& visit);
