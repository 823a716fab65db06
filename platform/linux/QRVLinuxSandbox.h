// The sandbox facility on Linux.
//
// Sandboxed: the process runs with no_new_privs and a seccomp filter.
//
// Extension tokens: text a sandbox launcher verifies on its own, without
// asking the daemon. A token names the extension class, the path, the
// holder's audit token and an expiry, sealed with a keyed MAC (libsodium's
// crypto_auth, HMAC-SHA-512-256) under a per-boot key kept in a root-only
// file under /run. The key is created on first use and read once; issuing
// afterwards touches no file. The format is documented in docs/linux.md.
//
// User-state items: the container mappings are kept in memory and published
// to the launcher as one property-list file, rewritten atomically (temporary
// file, fsync, rename, fsync of the directory) on a background queue after
// each change. Changes that arrive while a write is pending are folded into
// that write, so a burst costs one write. The file is read back at
// construction, so a daemon that exits when idle and starts again keeps the
// mappings of this boot.
//
// Thread-safe.
#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <tuple>
#include <vector>

#include "base/QRVMutex.h"
#include "base/QRVSerialQueue.h"
#include "platform/QRVSandbox.h"

class QRVLinuxSandbox : public QRVSandbox {
 public:
  // libsodium's crypto_auth_KEYBYTES.
  static constexpr size_t kKeySize = 32;
  using Key = std::array<uint8_t, kKeySize>;

  struct Options {
    std::string keyPath;       // <root>/run/quorva/extension.key
    std::string registryPath;  // <root>/run/quorva/sandbox.plist
    // How long an issued token stays valid. The per-boot key bounds it too.
    std::chrono::seconds extensionLifetime{std::chrono::hours(24)};
    // Where registry writes run; null makes a background queue of our own.
    std::shared_ptr<QRVSerialQueue> registryQueue;
  };

  explicit QRVLinuxSandbox(Options options);
  // Waits for a pending registry write, so the last change reaches the file.
  ~QRVLinuxSandbox() override;

  bool isSandboxed(const QRVAuditToken& token) override;
  // Fails with EINVAL for an empty class or a path that is not absolute, and
  // with the key's errno when the key cannot be created or read (EPERM: the
  // key file is not ours alone).
  std::optional<std::string> issueExtension(const std::string& extensionClass, const std::string& path,
                                            const QRVAuditToken& token, int* errnum) override;
  // EINVAL for an empty identifier or a path that is not absolute.
  int setUserStateItem(const QRVSandboxUserStateItem& item) override;

  // Returns once the registry file holds every change made before the call.
  // Must not be called from the registry queue.
  void flushRegistry();
  // The mappings as they are in memory, in file order.
  std::vector<QRVSandboxUserStateItem> userStateItems() const;
  // How many times the registry file has been written.
  uint64_t registryWriteCount() const;

  // --- The launcher's side ------------------------------------------------

  struct Extension {
    std::string extensionClass;
    std::string path;
    QRVAuditToken holder;
    int64_t expiry = 0;  // seconds since the Unix epoch
  };
  enum class Verdict { kValid, kMalformed, kBadSeal, kExpired, kWrongHolder };

  // Checks `token` against `key`: its seal first (nothing of an unsealed
  // token is trusted), then that `now` is before its expiry, then, when
  // `holder` is given, that the token was issued to that process. On kValid
  // and `out` given, stores what the token grants.
  static Verdict verifyExtension(const std::string& token, const Key& key, const QRVAuditToken* holder,
                                 std::chrono::system_clock::time_point now, Extension* out = nullptr);
  // Reads an existing key file; refuses one that is not a regular file of
  // exactly kKeySize bytes, owned by the caller and closed to others.
  static std::optional<Key> readKey(const std::string& path, int* errnum);

 private:
  using ItemKey = std::tuple<uint32_t, uint32_t, uint64_t, std::string>;  // uid, persona, type, identifier

  // The key, loaded or created on first use; null with `*errnum` on failure
  // (retried on the next call).
  const Key* key(int* errnum);
  void loadRegistry();
  void writeRegistry();

  const Options options_;
  const std::shared_ptr<QRVSerialQueue> registryQueue_;

  QRVMutex keyMutex_;
  std::optional<Key> key_ GUARDED_BY(keyMutex_);  // until `keyLoaded_`, then immutable
  std::atomic<bool> keyLoaded_{false};

  mutable QRVMutex registryMutex_;
  std::map<ItemKey, std::string> mappings_ GUARDED_BY(registryMutex_);
  bool writeScheduled_ GUARDED_BY(registryMutex_) = false;
  uint64_t writeCount_ GUARDED_BY(registryMutex_) = 0;
};
