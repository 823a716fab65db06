// Reading every entry of an open directory descriptor.
#pragma once

#include <dirent.h>

#include <functional>
#include <string>
#include <vector>

// Calls `visit` with each entry of the open directory `fd` other than "."
// and "..". The directory is read through a description of its own, so
// `fd`'s read position is neither used nor moved and `fd` stays usable for
// openat and fstatat meanwhile (even from inside `visit`). Stops at the first
// non-zero value `visit` returns and returns it; otherwise returns 0, or the
// errno of an open or read that failed.
int QRVForEachDirectoryEntry(int fd, const std::function<int(const dirent& entry)>& visit);

// Appends the name of each entry of the open directory `fd` other than "."
// and "..", each ended by '\0', to `names`. Unlike QRVForEachDirectoryEntry
// it reads through `fd`'s own read position (to the end) with getdents64
// into `buffer`, the caller's scratch space: a walk that reads every
// directory whole before using it saves a second description and the small
// reads of readdir. Returns 0 or the errno of the read that failed.
int QRVReadDirectoryNames(int fd, std::vector<char>* buffer, std::string* names);
