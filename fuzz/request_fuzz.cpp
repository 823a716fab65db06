// Sends structured requests through the real dispatcher and command table to
// daemon services on a temporary root, and checks what must hold whatever a
// client sends: exactly one well-formed reply, no exception inside a handler,
// paths handed back inside the root, refusals where the caller has no right,
// and nothing outside the root changed.
//
// An input is a short sequence of steps. Most steps are requests from one of
// a few callers; some play a hostile application that puts files, directories
// and links into containers it was handed (it owns their contents, so it may).
// Paths and UUIDs from replies are kept for the whole process, so containers
// made by one input are replaced, wiped and deleted by later ones.
//
// Layout, in a directory of its own under TMPDIR:
//   quorvad-test-XXXXXX/   the daemon's root (made by QRVTestServices)
//   sentinel/              must never change: escapes aim at it with "../"
//                          and with links planted inside containers
//   log/                   the daemon's log, at debug level

#include <dirent.h>
#include <fuzzer/FuzzedDataProvider.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "base/QRVLog.h"
#include "core/QRVCommandTable.h"
#include "core/QRVRelayDispatcher.h"
#include "support/QRVTestConnection.h"
#include "support/QRVTestServices.h"

namespace fs = std::filesystem;

namespace {

void check(bool ok, const char* what, const std::string& detail = {}) {
  if (ok) return;
  fprintf(stderr, "request_fuzz: %s %s\n", what, detail.c_str());
  __builtin_trap();
}

// ---- Callers ----

enum : pid_t { kAllowed = 100, kPlain, kWiper, kLooker, kAssets, kTester, kNoEntitlements, kUnknown = 999 };
// Half of the requests come from the unrestricted caller: most commands are
// refused to everyone else, and those refusals are found soon enough.
const pid_t kCallers[] = {kAllowed, kPlain,   kWiper,   kLooker,  kAssets,  kTester,  kNoEntitlements, kUnknown,
                          kAllowed, kAllowed, kAllowed, kAllowed, kAllowed, kAllowed, kAllowed,        kAllowed};

QRVPlist strings(std::initializer_list<const char*> values) {
  QRVPlist a = QRVPlist::array();
  for (const char* v : values) a.append(QRVPlist::string(v));
  return a;
}

void registerCallers(QRVFakeTrustStore& store) {
  auto yes = QRVPlist::boolean(true);
  store.setClient(kAllowed, {"com.kelva.fuzz.allowed", QRVPlist::dictionary().set(kEntitlementAllowed, yes)});
  store.setClient(kPlain, {"com.example.a", QRVPlist::dictionary()});
  store.setClient(kWiper,
                  {"com.example.wiper",
                   QRVPlist::dictionary().set(kEntitlementWipeContainer, strings({"com.example.a", "com.example.b"}))});
  QRVPlist lookup = QRVPlist::dictionary()
                        .set("appData", strings({"com.example.a"}))
                        .set("pluginData", strings({"com.example.b"}))
                        .set("systemData", strings({"com.example.a"}))
                        .set("appGroup", strings({"group.example"}));
  store.setClient(kLooker, {"com.example.looker", QRVPlist::dictionary().set(kEntitlementLookup, lookup)});
  // User-managed assets and the content rights, without being unrestricted.
  store.setClient(kAssets, {"com.example.b", QRVPlist::dictionary()
                                                 .set(kEntitlementUserManagedAssets, yes)
                                                 .set(kEntitlementDeleteContainerContent, yes)
                                                 .set(kEntitlementStageSharedContent, yes)
                                                 .set(kEntitlementOtherIdLookup, yes)});
  store.setClient(kTester, {"com.example.tester", QRVPlist::dictionary().set(kEntitlementTestability, yes)});
  store.setClient(kNoEntitlements, {"com.example.noents", std::nullopt});
}

// Whether a successful create-or-lookup by `pid` may name `identifier`.
bool mayLookUp(pid_t pid, const std::string& identifier) {
  switch (pid) {
    case kPlain:
      return identifier == "com.example.a";
    case kWiper:
      return identifier == "com.example.wiper";
    case kLooker:
      return identifier == "com.example.looker" || identifier == "com.example.a" || identifier == "com.example.b" ||
             identifier == "group.example";
    case kTester:
      return identifier == "com.example.tester";
    case kNoEntitlements:
      return identifier == "com.example.noents";
    default:
      return true;
  }
}

// ---- The environment ----

// A connection that also lets the fuzzer wait for a reply sent later, from
// another thread.
class WaitableConnection : public QRVTestConnection {
 public:
  using QRVTestConnection::QRVTestConnection;
  void sendReply(uint64_t messageId, const QRVPlist& reply) override {
    QRVTestConnection::sendReply(messageId, reply);
    std::lock_guard<std::mutex> lock(mutex_);
    count_++;
    changed_.notify_all();
  }
  size_t waitForReplies(size_t n, std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait_for(lock, timeout, [&] { return count_ >= n; });
    return count_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  size_t count_ = 0;
};

// Waits until every job queued on `queue` so far has run.
bool drained(QRVSerialQueue& queue, std::chrono::milliseconds timeout) {
  struct Marker {
    std::mutex mutex;
    std::condition_variable ran;
    bool done = false;
  };
  auto marker = std::make_shared<Marker>();
  queue.async([marker] {
    std::lock_guard<std::mutex> lock(marker->mutex);
    marker->done = true;
    marker->ran.notify_all();
  });
  std::unique_lock<std::mutex> lock(marker->mutex);
  return marker->ran.wait_for(lock, timeout, [&] { return marker->done; });
}

struct Environment {
  QRVTestServices env;
  QRVRelayDispatcher dispatcher{env.services};

  Environment() {
    registerCallers(*env.trustStore);
    // A personal and an enterprise persona, so persona strings name someone.
    env.personas->supported = true;
    env.personas->list = {{1000, 501, 501, QRVPersonaTypePersonal, "PERSONAL", "/private/var/mobile", {}, false, false},
                          {1001, 501, 501, QRVPersonaTypeEnterprise, "WORK", "/private/var/work", {}, false, false}};
    fs::create_directories(env.root.path() + "/private/var/work");
    env.services->userIdentityCache->flush();
  }
  ~Environment() {
    // Work still queued would recreate directories in a removed root.
    drained(*env.services->deathRowQueue, std::chrono::seconds(30));
    drained(*env.services->backgroundQueue, std::chrono::seconds(30));
  }
  const std::string& root() const { return env.root.path(); }
};

std::string gWork, gSentinel;
Environment* gEnv = nullptr;
uint64_t gRuns = 0;
// A fresh root every so many inputs keeps the state from slowing the runs
// down. QUORVAD_FUZZ_RESET_EVERY=1 gives every input a fresh root, so that a
// crash it finds is reproduced by its input alone.
uint64_t gResetEvery = 4000;

// What earlier requests handed back.
std::vector<std::string> gPaths;  // directories inside containers
std::vector<QRVPlist::Bytes> gUUIDs;
// Containers made or found by create-or-lookup: requests name them whole
// (identifier, class, UUID, persona) far more often than chance would.
struct Known {
  std::string identifier;
  uint64_t containerClass;
  QRVPlist::Bytes uuid;
  std::string persona;
};
std::vector<Known> gContainers;
template <typename T>
void remember(std::vector<T>& pool, T value) {
  if (pool.size() >= 32) pool.erase(pool.begin());
  pool.push_back(std::move(value));
}

struct FileState {
  ino_t ino;
  mode_t mode;
  uid_t uid;
  gid_t gid;
  off_t size;
  timespec mtime, ctime;
  bool operator==(const FileState& o) const {
    return ino == o.ino && mode == o.mode && uid == o.uid && gid == o.gid && size == o.size &&
           mtime.tv_sec == o.mtime.tv_sec && mtime.tv_nsec == o.mtime.tv_nsec && ctime.tv_sec == o.ctime.tv_sec &&
           ctime.tv_nsec == o.ctime.tv_nsec;
  }
};
FileState stateOf(const std::string& path) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) return {};
  return {st.st_ino, st.st_mode, st.st_uid, st.st_gid, st.st_size, st.st_mtim, st.st_ctim};
}
std::set<std::string> entriesOf(const std::string& path) {
  std::set<std::string> names;
  if (DIR* d = opendir(path.c_str())) {
    while (dirent* e = readdir(d))
      if (strcmp(e->d_name, ".") != 0 && strcmp(e->d_name, "..") != 0) names.insert(e->d_name);
    closedir(d);
  }
  return names;
}
std::string listing(const std::string& path) {
  std::string text = path + ":";
  for (const std::string& name : entriesOf(path)) text += " " + name;
  return text;
}
std::vector<FileState> gSentinelState;
std::vector<FileState> sentinelState() {
  return {stateOf(gSentinel), stateOf(gSentinel + "/canary"), stateOf(gSentinel + "/sub"),
          stateOf(gSentinel + "/sub/canary"), stateOf(gWork)};
}

// Nothing outside the root may change: not the sentinel, and nothing new
// next to the root.
void checkOutsideUntouched() {
  if (sentinelState() != gSentinelState) check(false, "sentinel or work directory changed;", listing(gSentinel));
  if (entriesOf(gSentinel) != std::set<std::string>{"canary", "sub"}) check(false, "changed", listing(gSentinel));
  std::set<std::string> expected = {fs::path(gEnv->root()).filename().string(), "sentinel", "log"};
  if (entriesOf(gWork) != expected) check(false, "new entry next to the root;", listing(gWork));
}

void resetEnvironment() {
  delete gEnv;
  gEnv = new Environment();
  gPaths.clear();
  gUUIDs.clear();
  gContainers.clear();
  // Creating a root changes the work directory itself.
  gSentinelState = sentinelState();
}

// ---- Values ----

std::vector<std::string> gHostile;  // built once the work directory is known
// Paths inside a container, as the asset and shared-content commands take
// them, many of them naming what plant() puts there.
std::vector<std::string> gRelativePaths = {
    "x",  "d",    "d/x",    "lnk", "lnk/", "lnk/canary", "lnk/sub", "Documents", "Library/Caches", "./x",
    "x/", "x/..", "d/../x", "..",  ".",    "",           "/x",      "../x",      "d/../../x"};

const char* const kIdentifiers[] = {"com.example.a",      "com.example.b",      "com.kelva.fuzz.allowed",
                                    "com.example.wiper",  "com.example.looker", "com.example.tester",
                                    "com.example.noents", "group.example",      "systemgroup.com.kelva.quorva.shared",
                                    "systemgroup.example"};
// Group identifiers the code-signing information of the fuzzer's identifiers
// claims, so that groups gain and lose claimants from one request to the next.
const char* const kGroups[] = {"group.example", "group.other", "systemgroup.example",
                               "systemgroup.com.kelva.quorva.shared", "notsystem.example"};
const char* const kPersonas[] = {"PERSONAL", "WORK", "", "NOBODY"};
const char* const kInfoKeys[] = {"com.kelva.Verdane.StaticDiskUsage", "com.kelva.Verdane.ContentProtectionClass", "k",
                                 ""};

std::string anyString(FuzzedDataProvider& in) {
  switch (in.ConsumeIntegralInRange(0, 3)) {
    case 0:
      return in.PickValueInArray(kIdentifiers);
    case 1:
      return gHostile[in.ConsumeIntegralInRange<size_t>(0, gHostile.size() - 1)];
    case 2:
      return gPaths.empty() ? gEnv->root() : gPaths[in.ConsumeIntegralInRange<size_t>(0, gPaths.size() - 1)];
    default:
      return in.ConsumeRandomLengthString(64);
  }
}

QRVPlist uuidData(FuzzedDataProvider& in) {
  if (!gUUIDs.empty() && in.ConsumeBool())
    return QRVPlist::data(gUUIDs[in.ConsumeIntegralInRange<size_t>(0, gUUIDs.size() - 1)]);
  size_t length = in.ConsumeBool() ? 16 : in.ConsumeIntegralInRange<size_t>(0, 40);
  QRVPlist::Bytes bytes = in.ConsumeBytes<uint8_t>(length);
  bytes.resize(length);
  return QRVPlist::data(std::move(bytes));
}

uint64_t anyNumber(FuzzedDataProvider& in) {
  const uint64_t interesting[] = {0, 1, 2, 7, 13, 14, 32, UINT32_MAX, UINT64_MAX, uint64_t{1} << 63};
  return in.ConsumeBool() ? in.PickValueInArray(interesting) : in.ConsumeIntegral<uint64_t>();
}

QRVPlist anyValue(FuzzedDataProvider& in, int depth = 0) {
  switch (in.ConsumeIntegralInRange(0, depth < 3 ? 8 : 6)) {
    case 0:
      return QRVPlist::boolean(in.ConsumeBool());
    case 1:
      return QRVPlist::uinteger(anyNumber(in));
    case 2:
      return QRVPlist::real(in.ConsumeFloatingPoint<double>());
    case 3:
      return QRVPlist::string(anyString(in));
    case 4:
      return uuidData(in);
    case 5:
      return QRVPlist::date({in.ConsumeFloatingPoint<double>()});
    case 6:
      return QRVPlist();
    case 7: {
      QRVPlist a = QRVPlist::array();
      for (int n = in.ConsumeIntegralInRange(0, 4); n > 0; n--) a.append(anyValue(in, depth + 1));
      return a;
    }
    default: {
      QRVPlist d = QRVPlist::dictionary();
      for (int n = in.ConsumeIntegralInRange(0, 4); n > 0; n--) d.set(anyString(in), anyValue(in, depth + 1));
      return d;
    }
  }
}

// Values of the type a key is read as, most of the time.
enum class Kind {
  Identifier,
  Class,
  UUID,
  UUIDOrString,
  Persona,
  Bool,
  InfoKey,
  Path,
  Number,
  Group,
  CodeSigningInfo,
  CodeSigningOptions,
  Any
};

QRVPlist someGroups(FuzzedDataProvider& in) {
  QRVPlist groups = QRVPlist::array();
  for (int n = in.ConsumeIntegralInRange(0, 3); n > 0; n--)
    groups.append(in.ConsumeIntegralInRange(0, 7) == 0 ? anyValue(in, 2)
                                                       : QRVPlist::string(in.PickValueInArray(kGroups)));
  return groups;
}

QRVPlist valueOf(Kind kind, FuzzedDataProvider& in) {
  if (in.ConsumeIntegralInRange(0, 7) == 0) return anyValue(in);
  switch (kind) {
    case Kind::Identifier:
      return QRVPlist::string(in.ConsumeBool() ? std::string(in.PickValueInArray(kIdentifiers)) : anyString(in));
    case Kind::Class:
      return QRVPlist::uinteger(in.ConsumeBool() ? in.PickValueInArray({2, 4, 7, 12, 13})
                                                 : in.ConsumeIntegralInRange(0, 20));
    case Kind::UUID:
      return uuidData(in);
    case Kind::UUIDOrString: {
      QRVPlist d = uuidData(in);
      if (d.dataValue().size() != 16 || in.ConsumeBool()) return d;
      auto uuid = QRVUUID::fromData(d.dataValue().data(), 16);
      return QRVPlist::string(uuid ? uuid->string() : std::string());
    }
    case Kind::Persona:
      return QRVPlist::string(in.ConsumeBool() ? in.PickValueInArray(kPersonas) : anyString(in));
    case Kind::Bool:
      return QRVPlist::boolean(in.ConsumeBool());
    case Kind::InfoKey:
      return QRVPlist::string(in.ConsumeBool() ? in.PickValueInArray(kInfoKeys) : anyString(in));
    case Kind::Path:
      if (in.ConsumeBool()) return QRVPlist::string(anyString(in));
      return QRVPlist::string(gRelativePaths[in.ConsumeIntegralInRange<size_t>(0, gRelativePaths.size() - 1)]);
    case Kind::Number:
      return QRVPlist::uinteger(anyNumber(in));
    case Kind::Group:
      return QRVPlist::string(in.ConsumeBool() ? std::string(in.PickValueInArray(kGroups)) : anyString(in));
    case Kind::CodeSigningInfo: {
      // Entitlements as the installer hands them over, now and then with a
      // value of the wrong type in place of a list.
      QRVPlist entitlements = QRVPlist::dictionary();
      if (in.ConsumeBool()) entitlements.set("com.kelva.security.application-groups", someGroups(in));
      if (in.ConsumeBool()) entitlements.set("com.kelva.security.system-groups", someGroups(in));
      if (in.ConsumeBool()) entitlements.set("com.kelva.security.system-container", QRVPlist::boolean(true));
      if (in.ConsumeIntegralInRange(0, 7) == 0) entitlements.set(anyString(in), anyValue(in, 2));
      return QRVPlist::dictionary().set("com.kelva.Quorva.Entitlements", std::move(entitlements));
    }
    case Kind::CodeSigningOptions: {
      QRVPlist options = QRVPlist::dictionary();
      if (in.ConsumeBool())
        options.set("com.kelva.Quorva.DataContainerClass", QRVPlist::uinteger(in.PickValueInArray({2, 4, 6, 9})));
      if (in.ConsumeBool())
        options.set("com.kelva.Quorva.ParentBundleID", QRVPlist::string(in.PickValueInArray(kIdentifiers)));
      if (in.ConsumeBool()) options.set("com.kelva.Quorva.PlaceholderEntitlements", QRVPlist::boolean(true));
      if (in.ConsumeBool()) options.set("com.kelva.Quorva.AdvanceCopy", QRVPlist::boolean(true));
      return options;
    }
    case Kind::Any:
      return anyValue(in);
  }
  return {};
}

struct Key {
  const char* name;
  Kind kind;
};
const Key kKeys[] = {
    {"Identifier", Kind::Identifier},
    {"ContainerClass", Kind::Class},
    {"UUID", Kind::UUID},
    {"PersonaUniqueString", Kind::Persona},
    {"CreateIfNecessary", Kind::Bool},
    {"Transient", Kind::Bool},
    {"InfoDictRequested", Kind::Bool},
    {"IsRelative", Kind::Bool},
    {"Key", Kind::InfoKey},
    {"Value", Kind::Any},
    {"OldIdentifier", Kind::Identifier},
    {"OldContainerClass", Kind::Class},
    {"OldContainerUUID", Kind::UUIDOrString},
    {"OldPersonaUniqueString", Kind::Persona},
    {"NewIdentifier", Kind::Identifier},
    {"NewContainerClass", Kind::Class},
    {"NewContainerUUID", Kind::UUIDOrString},
    {"NewPersonaUniqueString", Kind::Persona},
    {"SourcePath", Kind::Path},
    {"DestPath", Kind::Path},
    {"NumRetryCrashes", Kind::Number},
    {"TestLock", Kind::Number},
    {"Enable", Kind::Bool},
    {"GroupIdentifier", Kind::Group},
    {"CodeSigningInfo", Kind::CodeSigningInfo},
    {"OptionsDictionary", Kind::CodeSigningOptions},
};
// The stage-for-delete lists, read in step with each other.
const Key kLists[] = {{"ContainerClassesArray", Kind::Class},
                      {"UUIDsArray", Kind::UUIDOrString},
                      {"IdentifiersArray", Kind::Identifier},
                      {"PersonaUniqueStringsArray", Kind::Persona}};

QRVPlist buildRequest(FuzzedDataProvider& in, uint64_t* command) {
  QRVPlist request = QRVPlist::dictionary();
  *command = 0;  // what the dispatcher reads when "Command" is absent or not a number
  switch (in.ConsumeIntegralInRange(0, 15)) {
    case 0:
      break;
    case 1:
      request.set("Command", anyValue(in));
      break;
    default:
      *command = in.ConsumeIntegralInRange(0, 40);
      request.set("Command", QRVPlist::uinteger(*command));
  }
  if (const QRVPlist* c = request.get("Command"); c && c->type() == QRVPlist::Type::UInteger)
    *command = c->uint64Value();
  // The keys nearly every handler reads, then a few more. Bits 0-3 add
  // Identifier, ContainerClass, UUID and PersonaUniqueString; 0x10 asks for
  // creation, 0x80 adds a path; 0x40 names known containers and 0x20 adds the
  // stage-for-delete lists.
  uint8_t common = in.ConsumeIntegral<uint8_t>();
  for (int i = 0; i < 4; i++)
    if (common & (1 << i)) request.set(kKeys[i].name, valueOf(kKeys[i].kind, in));
  if (common & 0x10) request.set("CreateIfNecessary", QRVPlist::boolean(true));
  if (common & 0x80) request.set("SourcePath", valueOf(Kind::Path, in));
  if ((common & 0x40) && !gContainers.empty()) {
    // A known container under the plain keys, and one each as the old and
    // the new side of a replace.
    for (const char* prefix : {"", "Old", "New"}) {
      const Known& k = gContainers[in.ConsumeIntegralInRange<size_t>(0, gContainers.size() - 1)];
      const std::string p = prefix;
      request.set(p + "Identifier", QRVPlist::string(k.identifier));
      request.set(p + "ContainerClass", QRVPlist::uinteger(k.containerClass));
      request.set(p.empty() ? "UUID" : p + "ContainerUUID", QRVPlist::data(k.uuid));
      if (!k.persona.empty() && in.ConsumeBool()) request.set(p + "PersonaUniqueString", QRVPlist::string(k.persona));
    }
  }
  if (common & 0x20) {
    // Entries of known containers or of made-up values; now and then one
    // list is longer than the others.
    QRVPlist lists[4] = {QRVPlist::array(), QRVPlist::array(), QRVPlist::array(), QRVPlist::array()};
    for (size_t n = in.ConsumeIntegralInRange(0, 3); n > 0; n--) {
      if (!gContainers.empty() && in.ConsumeBool()) {
        const Known& k = gContainers[in.ConsumeIntegralInRange<size_t>(0, gContainers.size() - 1)];
        lists[0].append(QRVPlist::uinteger(k.containerClass));
        lists[1].append(QRVPlist::data(k.uuid));
        lists[2].append(QRVPlist::string(k.identifier));
        lists[3].append(QRVPlist::string(k.persona));
      } else {
        for (int i = 0; i < 4; i++) lists[i].append(valueOf(kLists[i].kind, in));
      }
    }
    if (in.ConsumeIntegralInRange(0, 15) == 0) {
      int i = in.ConsumeIntegralInRange(0, 3);
      lists[i].append(valueOf(kLists[i].kind, in));
    }
    for (int i = 0; i < 4; i++) request.set(kLists[i].name, std::move(lists[i]));
  }
  for (int n = in.ConsumeIntegralInRange(0, 5); n > 0; n--) {
    if (in.ConsumeIntegralInRange(0, 15) == 0) {
      request.set(anyString(in), anyValue(in));
    } else {
      const Key& key = in.PickValueInArray(kKeys);
      request.set(key.name, valueOf(key.kind, in));
    }
  }
  return request;
}

// ---- Steps ----

bool isInsideRoot(const std::string& path) {
  const std::string& root = gEnv->root();
  return path.size() > root.size() + 1 && path.compare(0, root.size(), root) == 0 && path[root.size()] == '/';
}

// One request from one caller, and what must hold for its reply.
void sendRequest(FuzzedDataProvider& in) {
  const pid_t pid = in.PickValueInArray(kCallers);
  const uid_t uid = in.ConsumeIntegralInRange(0, 7) == 0 ? in.PickValueInArray({0u, 33u, 502u}) : 501u;
  auto connection = std::make_shared<WaitableConnection>(pid, uid, uid);
  if (in.ConsumeIntegralInRange(0, 3) == 0) connection->persona = in.PickValueInArray({1000u, 1001u, 4242u});
  const bool wantsReply = in.ConsumeIntegralInRange(0, 31) != 0;
  uint64_t command = 0;
  QRVPlist request = buildRequest(in, &command);
  const uint64_t messageId = in.ConsumeIntegral<uint64_t>();

  static const bool verbose = getenv("QUORVAD_FUZZ_VERBOSE") != nullptr;
  if (verbose)
    fprintf(stderr, "request_fuzz: pid %d uid %u persona %d reply %d: %s\n", pid, uid,
            connection->persona ? static_cast<int>(*connection->persona) : -1, wantsReply,
            request.description().c_str());

  Environment& e = *gEnv;
  e.dispatcher.QRVProcessRelayEvent(connection, connection->message(request, messageId, wantsReply));
  // Emptying death row answers from the death-row queue once it is done.
  size_t replies = connection->waitForReplies(wantsReply ? 1 : 0, std::chrono::seconds(20));
  check(drained(*e.env.services->deathRowQueue, std::chrono::seconds(20)), "death row did not drain");
  check(drained(*e.env.services->backgroundQueue, std::chrono::seconds(20)), "background queue did not drain");
  replies = connection->waitForReplies(wantsReply ? 1 : 0, std::chrono::milliseconds(0));
  check(e.env.messages->transactions == 0, "keep-alive transaction left open");

  if (!wantsReply) {
    check(replies == 0 && connection->cancelled, "a message without reply context was answered");
    return;
  }
  check(replies == 1, "not exactly one reply for command", std::to_string(command));
  const auto& [id, reply] = connection->replies[0];
  check(id == messageId, "reply to another message");
  check(reply.isDictionary(), "reply is not a dictionary");
  const QRVPlist* error = reply.get("ReplyError");
  check(error && error->type() == QRVPlist::Type::UInteger, "no numeric ReplyError");
  const uint64_t code = error->uint64Value();
  // Handlers turn exceptions, and failures that carry no code, into 40;
  // neither should happen on any input.
  check(code != QRVResultCode::kException, "handler threw or failed without a code for command",
        std::to_string(command));
  const QRVCommandTable& table = QRVDefaultCommandTable();
  const bool valid = command < kQRVCommandCount && table[command].handler;
  if (!valid) check(code == QRVResultCode::kInvalidCommand, "invalid command not refused with 49");
  // Callers without any entitlement get only the open commands.
  if (valid && (pid == kPlain || pid == kNoEntitlements || pid == kUnknown) &&
      !table[command].allowedWithoutEntitlement)
    check(code == QRVResultCode::kNotEntitled, "unentitled caller ran command", std::to_string(command));
  if (code != QRVResultCode::kSuccess) return;

  // The built-in table lists a few containers that every caller may look
  // up (the shared system group among them); nothing else of another
  // identifier is handed out.
  if (command == 0)
    check(mayLookUp(pid, reply.stringForKey("ReplyIdentifier")) ||
              e.env.services->wellKnownNames->isLookupWhitelistedFromCodeSignIdentifier(
                  "", request.uint64ForKey("ContainerClass"), reply.stringForKey("ReplyIdentifier")),
          "caller got another identifier's container", reply.stringForKey("ReplyIdentifier"));
  // Another owner's groups need a right to look that owner up.
  if ((command == 13 || command == 16) && request.get("Identifier"))
    check(mayLookUp(pid, request.stringForKey("Identifier")), "caller got another owner's groups",
          request.stringForKey("Identifier"));
  for (const auto& [group, groupPath] : reply.dictionaryForKey("ReplyGroupContainerDict")) {
    check(groupPath.isString() && isInsideRoot(groupPath.stringValue()), "group path outside the root", group);
    if (groupPath.isString()) remember(gPaths, groupPath.stringValue());
  }
  for (const auto& [group, groupToken] : reply.dictionaryForKey("SandboxTokenDict")) {
    const std::string& text = groupToken.stringValue();
    if (size_t semicolon = text.find(';'); semicolon != std::string::npos)
      check(isInsideRoot(text.substr(semicolon + 1)), "group sandbox token outside the root", text);
  }
  // Paths handed back name places inside the root, or are relative.
  const std::string& path = reply.stringForKey("ReplyPath");
  if (!path.empty() && (path[0] == '/' || command != 28)) check(isInsideRoot(path), "path outside the root", path);
  const std::string& token = reply.stringForKey("SandboxToken");
  if (size_t semicolon = token.find(';'); semicolon != std::string::npos)
    check(isInsideRoot(token.substr(semicolon + 1)), "sandbox token outside the root", token);
  if (!path.empty() && path[0] == '/') remember(gPaths, path);
  if (command == 0)
    remember(gContainers, Known{reply.stringForKey("ReplyIdentifier"), request.uint64ForKey("ContainerClass"),
                                reply.dataForKey("ReplyUUID"), reply.stringForKey("ReplyPersonaUniqueString")});
  if (reply.dataForKey("ReplyUUID").size() == 16) remember(gUUIDs, reply.dataForKey("ReplyUUID"));
  for (const QRVPlist& uuid : reply.arrayForKey("ReplyUUIDsArray"))
    if (uuid.dataValue().size() == 16) remember(gUUIDs, uuid.dataValue());
}

// A hostile application changing what lies inside a container it was
// handed: files, directories, and links that lead out of it (only ever
// towards the sentinel), also in place of what the daemon put there.
void plant(FuzzedDataProvider& in) {
  if (gPaths.empty()) return;
  std::string directory = gPaths[in.ConsumeIntegralInRange<size_t>(0, gPaths.size() - 1)];
  // A path handed back may lead through a link planted earlier; the
  // application has no business outside its container either.
  char* real = realpath(directory.c_str(), nullptr);
  if (!real) return;
  directory = real;
  free(real);
  if (!isInsideRoot(directory)) return;
  std::set<std::string> existing = entriesOf(directory);
  std::string name = in.PickValueInArray({"x", "lnk", "d", "Documents"});
  if (!existing.empty() && in.ConsumeBool()) {
    auto it = existing.begin();
    std::advance(it, in.ConsumeIntegralInRange<size_t>(0, existing.size() - 1));
    name = *it;
  }
  const std::string path = directory + "/" + name;
  std::string target;
  switch (in.ConsumeIntegralInRange(0, 4)) {
    case 0:
      target = gSentinel;
      break;
    case 1:
      target = gSentinel + "/canary";
      break;
    case 2:
      target = gSentinel + "/sub";
      break;
    case 3:
      target = "..";
      break;
    default:
      for (int n = in.ConsumeIntegralInRange(1, 14); n > 0; n--) target += "../";
      target += "sentinel";
  }
  // An item already there moves aside, as a user replacing it would.
  if (existing.count(name) && rename(path.c_str(), (path + "~").c_str()) != 0) return;
  switch (in.ConsumeIntegralInRange(0, 3)) {
    case 0:
      std::ofstream(path) << "x";
      break;
    case 1:
      mkdir(path.c_str(), 0755);
      std::ofstream(path + "/x") << "x";
      break;
    default:
      if (symlink(target.c_str(), path.c_str()) != 0) return;
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // The retry test (25) ends the process on purpose and the test locks (31)
  // can hold later requests at blocking points for good; both act only on an
  // internal build. The fake build is not internal, so both answer success
  // without doing anything, and they stay in the fuzzed command range for
  // their gating and that refusal. Crash points likewise need an internal
  // build and are named by the environment.
  unsetenv("QUORVAD_CRASH_AT");
  if (const char* every = getenv("QUORVAD_FUZZ_RESET_EVERY")) gResetEvery = std::max(1, atoi(every));

  std::string pattern = (fs::temp_directory_path() / "quorvad-rfuzz-XXXXXX").string();
  check(mkdtemp(pattern.data()) != nullptr, "cannot make a work directory");
  gWork = pattern;
  // Kept after a crash, for a look at what the daemon left.
  atexit([] {
    std::error_code ignored;
    fs::remove_all(gWork, ignored);
  });
  gSentinel = gWork + "/sentinel";
  fs::create_directories(gSentinel + "/sub");
  std::ofstream(gSentinel + "/canary") << "canary";
  std::ofstream(gSentinel + "/sub/canary") << "canary";
  fs::create_directories(gWork + "/log");
  // The root goes next to the sentinel: QRVTestServices makes it in TMPDIR.
  setenv("TMPDIR", gWork.c_str(), 1);
  QRVLog::open("quorvad-fuzz", gWork + "/log/quorvad.log", QRVLogLevel::kDebug, 1, 4 << 20);

  // clang-format off
  gHostile = {"", ".", "..", "../..", "/", "//", "/etc", "a/../../b", "./x", "x/", "x/..", "~", "*", "{}", "%s%n",
              std::string(5000, 'a'), std::string("com.example.a\0b", 15), "\xff\xfe", "\xc3\x28", "com.example.a/",
              "com.example.a/../com.example.b", "lnk", "lnk/", "lnk/canary", "d/x", "sentinel", gSentinel,
              gSentinel + "/canary"};
  // clang-format on
  for (int n = 1; n <= 14; n++) {
    std::string up;
    for (int i = 0; i < n; i++) up += "../";
    gHostile.push_back(up + "sentinel");
    gRelativePaths.push_back(up + "sentinel");
    gRelativePaths.push_back(up + "sentinel/canary");
  }
  resetEnvironment();
  check(!gEnv->env.services->globalConfiguration->isInternalImage(), "the environment must not be internal");
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (++gRuns % gResetEvery == 0) resetEnvironment();
  FuzzedDataProvider in(data, size);
  for (int steps = 0; steps < 8 && in.remaining_bytes() > 0; steps++) {
    if (in.ConsumeIntegralInRange(0, 7) == 0)
      plant(in);
    else
      sendRequest(in);
    checkOutsideUntouched();
  }
  return 0;
}
