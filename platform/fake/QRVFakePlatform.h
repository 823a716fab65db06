// In-memory stand-ins for the platform services, for tests. Each holds plain
// state that a test sets and inspects; none restates the real logic.
#pragma once

#include <atomic>
#include <cerrno>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "platform/QRVAccounts.h"
#include "platform/QRVApplicationTermination.h"
#include "platform/QRVFeatureFlags.h"
#include "platform/QRVFirstBootMarker.h"
#include "platform/QRVInstanceLock.h"
#include "platform/QRVLockStateService.h"
#include "platform/QRVNotificationService.h"
#include "platform/QRVPersonaService.h"
#include "platform/QRVSandbox.h"
#include "platform/QRVSystemInfo.h"
#include "platform/QRVTrustStore.h"
#include "platform/QRVUpcallTransport.h"

class QRVFakeTrustStore : public QRVTrustStore {
 public:
  struct Client {
    std::string signingIdentifier;  // empty: the identifier cannot be read
    std::optional<QRVPlist> entitlements;
  };
  void setClient(pid_t pid, Client client) {
    std::lock_guard<std::mutex> l(m_);
    clients_[pid] = std::move(client);
    changes_++;
  }
  std::optional<uint64_t> changeCount() override { return changes_.load(); }
  std::optional<std::string> signingIdentifierForAuditToken(const QRVAuditToken& token, QRVError* error) override {
    std::lock_guard<std::mutex> l(m_);
    auto it = clients_.find(token.pid());
    if (it == clients_.end() || it->second.signingIdentifier.empty()) {
      QRVFail(error, QRV_POSIX_ERROR_QUIET(ESRCH, "no signing identifier for pid {}", token.pid()));
      return std::nullopt;
    }
    return it->second.signingIdentifier;
  }
  std::optional<QRVPlist> entitlementsForAuditToken(const QRVAuditToken& token) override {
    std::lock_guard<std::mutex> l(m_);
    auto it = clients_.find(token.pid());
    return it == clients_.end() ? std::nullopt : it->second.entitlements;
  }

 private:
  std::mutex m_;
  std::map<pid_t, Client> clients_;
  std::atomic<uint64_t> changes_{0};
};

class QRVFakeLockStateService : public QRVLockStateService {
 public:
  int state = 0;
  int registrationResult = 0;
  std::function<void()> onChange;
  int currentLockState() override { return state; }
  int observe(std::function<void()> handler) override {
    if (registrationResult == 0) onChange = std::move(handler);
    return registrationResult;
  }
  // Changes the state and notifies, as the device would.
  void change(int newState) {
    state = newState;
    if (onChange) onChange();
  }
};

class QRVFakeNotificationService : public QRVNotificationService {
 public:
  uint32_t post(const std::string& name) override {
    std::lock_guard<std::mutex> l(m_);
    posted_.push_back(name);
    return result;
  }
  std::vector<std::string> posted() {
    std::lock_guard<std::mutex> l(m_);
    return posted_;
  }
  uint32_t result = 0;

 private:
  std::mutex m_;
  std::vector<std::string> posted_;
};

class QRVFakeFirstBootMarker : public QRVFirstBootMarker {
 public:
  bool present = false;
  int createError = 0;
  const std::string& name() const override { return name_; }
  bool exists() override { return present; }
  bool create(int* errnum) override {
    if (createError) {
      if (errnum) *errnum = createError;
      return false;
    }
    present = true;
    return true;
  }

 private:
  std::string name_ = "quorvad.fb_check";
};

// A claim that is either free or held by "another daemon".
class QRVFakeInstanceLock : public QRVInstanceLock {
 public:
  bool heldElsewhere = false;
  bool held = false;
  const std::string& path() const override { return path_; }
  bool acquire(QRVError* error) override {
    if (heldElsewhere) return QRVFail(error, QRV_POSIX_ERROR_QUIET(EWOULDBLOCK, "held by another daemon"));
    held = true;
    return true;
  }

 private:
  std::string path_ = "quorvad.lock";
};

class QRVFakeSystemInfo : public QRVSystemInfo {
 public:
  bool internal = false;
  std::string build = "1A1";
  bool isInternalBuild() override { return internal; }
  std::string buildVersion() override { return build; }
  QRVPlist systemVersion() override { return QRVPlist::dictionary().set("BUILD_ID", QRVPlist::string(build)); }
};

class QRVFakeAccounts : public QRVAccounts {
 public:
  std::vector<QRVAccount> accounts;
  std::map<std::string, gid_t> groups;
  std::optional<QRVAccount> accountForName(const std::string& name) override {
    for (const auto& a : accounts)
      if (a.name == name) return a;
    return std::nullopt;
  }
  std::optional<QRVAccount> accountForUID(uid_t uid) override {
    for (const auto& a : accounts)
      if (a.uid == uid) return a;
    return std::nullopt;
  }
  std::optional<gid_t> groupIDForName(const std::string& name) override {
    auto it = groups.find(name);
    return it == groups.end() ? std::nullopt : std::optional<gid_t>(it->second);
  }
};

class QRVFakeSandbox : public QRVSandbox {
 public:
  std::map<pid_t, bool> sandboxed;
  bool isSandboxed(const QRVAuditToken& token) override { return sandboxed[token.pid()]; }
  std::optional<std::string> issueExtension(const std::string& extensionClass, const std::string& path,
                                            const QRVAuditToken&, int*) override {
    return extensionClass + ";" + path;
  }
  // Every item pushed, in order; `userStateResult` is what each push answers.
  std::vector<QRVSandboxUserStateItem> userStateItems;
  int userStateResult = 0;
  int setUserStateItem(const QRVSandboxUserStateItem& item) override {
    std::lock_guard<std::mutex> l(m_);
    userStateItems.push_back(item);
    return userStateResult;
  }

 private:
  std::mutex m_;
};

class QRVFakeFeatureFlags : public QRVFeatureFlags {
 public:
  std::map<std::string, bool> flags;  // "domain/feature"
  bool isEnabled(const std::string& domain, const std::string& feature) override {
    return flags[domain + "/" + feature];
  }
};

class QRVFakePersonaService : public QRVPersonaService {
 public:
  bool supported = false;
  std::vector<QRVPersona> list;
  uint64_t flags = 0;
  int fetches = 0;
  std::function<void()> onChange;
  bool personasSupported() override { return supported; }
  std::vector<QRVPersona> personas() override {
    fetches++;
    return list;
  }
  std::optional<QRVPersona> personaForID(uint32_t id) override {
    for (const auto& p : list)
      if (p.personaID == id) return p;
    return std::nullopt;
  }
  void observe(std::function<void()> handler) override { onChange = std::move(handler); }
  uint64_t multiUserFlags() override { return flags; }
  // Replaces the list and notifies, as the device would.
  void change(std::vector<QRVPersona> personas) {
    list = std::move(personas);
    if (onChange) onChange();
  }
};

// Records which applications were stopped and how many assertions are held.
class QRVFakeApplicationTermination : public QRVApplicationTermination {
 public:
  class Held : public Assertion {
   public:
    explicit Held(QRVFakeApplicationTermination& owner) : owner_(owner) { owner_.held++; }
    ~Held() override { owner_.held--; }

   private:
    QRVFakeApplicationTermination& owner_;
  };
  std::unique_ptr<Assertion> terminate(const std::string& identifier, const std::string& reason,
                                       QRVError* error) override {
    if (refuse) {
      QRVFail(error, QRV_ERROR(1, "refused"));
      return nullptr;
    }
    terminated.push_back(identifier + ":" + reason);
    return std::make_unique<Held>(*this);
  }
  bool refuse = false;
  int held = 0;
  std::vector<std::string> terminated;
};

// An upcall transport that serves nobody: it keeps what the server checked
// in, so a test can see that it did, or refuses the check-in.
class QRVFakeUpcallTransport : public QRVUpcallTransport {
 public:
  bool refuseCheckIn = false;
  std::string name;
  std::shared_ptr<QRVSerialQueue> queue;
  Handler handler;
  bool checkIn(const std::string& serviceName, std::shared_ptr<QRVSerialQueue> serviceQueue, Handler serviceHandler,
               QRVError* error) override {
    if (refuseCheckIn) return QRVFail(error, QRV_POSIX_ERROR_QUIET(EADDRINUSE, "{} is taken", serviceName));
    name = serviceName;
    queue = std::move(serviceQueue);
    handler = std::move(serviceHandler);
    return true;
  }
};
