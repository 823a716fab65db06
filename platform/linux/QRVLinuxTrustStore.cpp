#include "platform/linux/QRVLinuxTrustStore.h"

#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "base/QRVLog.h"

QRVLinuxTrustStore::QRVLinuxTrustStore(std::string directory) : directory_(std::move(directory)) {
  inotifyFd_ = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  if (inotifyFd_ >= 0 &&
      inotify_add_watch(inotifyFd_, directory_.c_str(),
                        IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_CREATE | IN_DELETE |
                            IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF) < 0) {
    // Without a watch the store is read on every look-up instead.
    ::close(inotifyFd_);
    inotifyFd_ = -1;
  }
}

QRVLinuxTrustStore::~QRVLinuxTrustStore() {
  if (inotifyFd_ >= 0) ::close(inotifyFd_);
}

void QRVLinuxTrustStore::reloadIfChangedLocked() {
  if (inotifyFd_ < 0) {
    loadLocked();
    return;
  }
  bool changed = drainEvents();
  if (reloadNeeded_.exchange(false)) changed = true;
  if (changed || !loaded_) loadLocked();
}

bool QRVLinuxTrustStore::drainEvents() {
  bool any = false;
  alignas(inotify_event) char buf[4096];
  while (read(inotifyFd_, buf, sizeof buf) > 0) any = true;
  if (any) {
    reloadNeeded_ = true;
    changes_++;
  }
  return any;
}

std::optional<uint64_t> QRVLinuxTrustStore::changeCount() {
  if (inotifyFd_ < 0) return std::nullopt;
  drainEvents();
  return changes_.load();
}

void QRVLinuxTrustStore::loadLocked() {
  loaded_ = true;
  entries_.clear();
  std::error_code ec;
  std::vector<std::filesystem::path> files;
  for (const auto& de : std::filesystem::directory_iterator(directory_, ec))
    if (de.path().extension() == ".plist") files.push_back(de.path());
  std::sort(files.begin(), files.end());
  for (const auto& path : files) {
    std::ifstream in(path, std::ios::binary);
    std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    auto plist = QRVPlist::fromBytes(bytes.data(), bytes.size());
    if (!plist || !plist->isDictionary()) {
      QRVLogError("ignoring unreadable trust-store entry {}", path.string());
      continue;
    }
    Entry e;
    e.file = path.filename().string();
    e.signingIdentifier = plist->stringForKey("SigningIdentifier");
    if (const QRVPlist* ents = plist->get("Entitlements"); ents && ents->isDictionary())
      e.entitlements = *ents;
    if (const QRVPlist* exe = plist->get("Executable"); exe && exe->isString()) {
      struct stat st;
      if (stat(exe->stringValue().c_str(), &st) == 0)
        e.executable = QRVProcInfo::FileId{st.st_dev, st.st_ino};
      else
        e.executableMissing = true;
    }
    if (const QRVPlist* uid = plist->get("UID"); uid && uid->type() == QRVPlist::Type::UInteger)
      e.uid = static_cast<uid_t>(uid->uint64Value());
    if (e.signingIdentifier.empty() || (!e.executable && !e.executableMissing && !e.uid)) {
      QRVLogError("ignoring trust-store entry {}: it needs a SigningIdentifier and an Executable or UID",
                  e.file);
      continue;
    }
    entries_.push_back(std::move(e));
  }
}

const QRVLinuxTrustStore::Entry* QRVLinuxTrustStore::match(const QRVAuditToken& token) {
  // The token must still describe the live process: a pid whose start time
  // changed belongs to someone else now.
  std::optional<uint64_t> start = QRVProcInfo::startTime(token.pid());
  if (!start || *start != token.startTime()) return nullptr;
  std::optional<QRVProcInfo::FileId> exe;
  bool exeRead = false;
  reloadIfChangedLocked();
  for (const Entry& e : entries_) {
    if (e.executableMissing) continue;
    if (e.uid && *e.uid != token.uid()) continue;
    if (e.executable) {
      if (!exeRead) {
        exe = QRVProcInfo::executable(token.pid());
        exeRead = true;
      }
      if (!exe || !(*exe == *e.executable)) continue;
    }
    return &e;
  }
  return nullptr;
}

std::optional<std::string> QRVLinuxTrustStore::signingIdentifierForAuditToken(const QRVAuditToken& token,
                                                                              QRVError* error) {
  QRVMutexLock lock(&mutex_);
  if (const Entry* e = match(token)) return e->signingIdentifier;
  QRVFail(error, QRV_POSIX_ERROR_QUIET(ESRCH, "no signing identifier for pid {}", token.pid()));
  return std::nullopt;
}

std::optional<QRVPlist> QRVLinuxTrustStore::entitlementsForAuditToken(const QRVAuditToken& token) {
  QRVMutexLock lock(&mutex_);
  if (const Entry* e = match(token)) return e->entitlements;
  return std::nullopt;
}

std::optional<std::string> QRVLinuxTrustStore::executablePathForUnlistedAuditToken(const QRVAuditToken& token) {
  {
    QRVMutexLock lock(&mutex_);
    if (match(token)) return std::nullopt;
  }
  std::optional<uint64_t> start = QRVProcInfo::startTime(token.pid());
  if (!start || *start != token.startTime()) return std::nullopt;
  std::optional<std::string> path = QRVProcInfo::executablePath(token.pid());
  // The pid may have been reused while the link was read: the path counts
  // only if the process that was asked about is still the one running.
  start = QRVProcInfo::startTime(token.pid());
  if (!start || *start != token.startTime()) return std::nullopt;
  return path;
}
