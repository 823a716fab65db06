// Container classes: what kind of container a number names, where such
// containers live and who owns them. The class sets are bit masks over the
// class number, so every component agrees on them.
#pragma once

#include <sys/types.h>

#include <cstdint>

using QRVContainerClass = uint64_t;

enum : QRVContainerClass {
  QRVContainerClassUndefined = 0,
  QRVContainerClassAppBundle = 1,
  QRVContainerClassAppData = 2,
  QRVContainerClassPluginBundle = 3,
  QRVContainerClassPluginData = 4,
  QRVContainerClassVPNPluginBundle = 5,
  QRVContainerClassVPNPluginData = 6,
  QRVContainerClassAppGroup = 7,
  QRVContainerClassFrameworkBundle = 8,
  QRVContainerClassRelayServiceData = 9,
  QRVContainerClassInternalDaemonData = 10,
  QRVContainerClassTempDir = 11,
  QRVContainerClassSystemData = 12,
  QRVContainerClassSystemGroup = 13,
  QRVContainerClassMax = 14,
};

// The installer account owns bundle containers; the system account owns
// system containers. Both ids are used as group ids too, on purpose.
constexpr uid_t CONTAINER_INSTALLATION_UID = 33;
constexpr uid_t CONTAINER_SYSTEM_UID = 0;

// 1, 3, 5, 8.
constexpr bool QRVContainerClassIsBundle(QRVContainerClass c) { return c < 9 && ((0x12aULL >> c) & 1); }
// 12, 13.
constexpr bool QRVContainerClassIsSystem(QRVContainerClass c) { return (c | 1) == 13; }
// 2, 4, 6, 9, 10, 11: data containers, an application's or a service's own
// data in a user's tree (system data, class 12, is a system container).
constexpr bool QRVContainerClassIsData(QRVContainerClass c) { return c < 12 && ((0xe54ULL >> c) & 1); }
// 2, 4, 6, 7, 9, 10, 11: containers that live in a user's tree.
constexpr bool QRVContainerClassIsPerUser(QRVContainerClass c) { return c < 12 && ((0xed4ULL >> c) & 1); }
// 1 to 13.
constexpr bool QRVContainerClassIsValid(QRVContainerClass c) { return c - 1 < 13; }

// The directory, relative to the class's base, under which containers of the
// class live ("Data/Application"); "Undefined" for 0 and "MAX" for 14; null
// beyond the table.
const char* QRVContainerClassRelativeDirectory(QRVContainerClass c);
