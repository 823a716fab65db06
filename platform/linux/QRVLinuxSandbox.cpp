#include "platform/linux/QRVLinuxSandbox.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include <sodium.h>

#include "base/QRVLog.h"
#include "base/QRVPlist.h"
#include "platform/linux/QRVProcInfo.h"

static_assert(QRVLinuxSandbox::kKeySize == crypto_auth_KEYBYTES);

namespace {

constexpr const char* kTokenTag = "qx1";
constexpr size_t kMacHexLength = crypto_auth_BYTES * 2;
constexpr size_t kHolderHexLength = 64;  // eight 32-bit words

// Registry file keys.
constexpr const char* kRegistryVersionKey = "QRVSandboxVersion";
constexpr const char* kRegistryItemsKey = "QRVSandboxItems";
constexpr const char* kItemUIDKey = "QRVSandboxUID";
constexpr const char* kItemPersonaKey = "QRVSandboxPersonaID";
constexpr const char* kItemTypeKey = "QRVSandboxItemType";
constexpr const char* kItemIdentifierKey = "QRVSandboxIdentifier";
constexpr const char* kItemPathKey = "QRVSandboxPath";
constexpr uint64_t kRegistryVersion = 1;

std::string parentDirectory(const std::string& path) {
  size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

// mkdir -p with mode 0755; true when the directory exists afterwards.
bool ensureDirectory(const std::string& path) {
  for (size_t pos = 1; pos <= path.size(); pos++) {
    if (pos != path.size() && path[pos] != '/') continue;
    std::string prefix = path.substr(0, pos);
    if (mkdir(prefix.c_str(), 0755) != 0 && errno != EEXIST) return false;
  }
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return false;
  if (!S_ISDIR(st.st_mode)) {
    errno = ENOTDIR;
    return false;
  }
  return true;
}

bool writeAll(int fd, const uint8_t* data, size_t size) {
  while (size > 0) {
    ssize_t n = write(fd, data, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    data += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

// Writes `bytes` to a new file beside `path` and renames it over `path`, so
// that a reader sees the old file or the new one, whole. Nothing is flushed:
// the registry lives in /run for one boot, and a power loss that could lose
// an unflushed write ends that boot and the file with it (on the disk of a
// test root the flushes only cost every creation two more). Returns 0 or an
// errno.
int writeAtomically(const std::string& path, const uint8_t* bytes, size_t size, mode_t mode) {
  const std::string directory = parentDirectory(path);
  if (!ensureDirectory(directory)) return errno ? errno : ENOTDIR;
  std::string temporary = path + ".XXXXXX";
  int fd = mkostemp(temporary.data(), O_CLOEXEC);
  if (fd < 0) return errno;
  int err = 0;
  if (fchmod(fd, mode) != 0 || !writeAll(fd, bytes, size)) err = errno ? errno : EIO;
  if (close(fd) != 0 && err == 0) err = errno;
  if (err == 0 && rename(temporary.c_str(), path.c_str()) != 0) err = errno;
  if (err != 0) unlink(temporary.c_str());
  return err;
}

// --- Token text ------------------------------------------------------------

bool isPlainTokenByte(unsigned char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
         strchr("-._~/+,=@:", c) != nullptr;
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// Bytes outside a small safe set become %XX, so a field never holds the
// separator and every text has exactly one encoding.
std::string percentEncode(const std::string& text) {
  static const char* digits = "0123456789ABCDEF";
  std::string out;
  out.reserve(text.size());
  for (unsigned char c : text) {
    if (c != 0 && isPlainTokenByte(c)) {
      out.push_back(static_cast<char>(c));
    } else {
      out.push_back('%');
      out.push_back(digits[c >> 4]);
      out.push_back(digits[c & 15]);
    }
  }
  return out;
}

std::optional<std::string> percentDecode(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (size_t i = 0; i < text.size(); i++) {
    unsigned char c = static_cast<unsigned char>(text[i]);
    if (c == '%') {
      if (i + 2 >= text.size()) return std::nullopt;
      int high = hexValue(text[i + 1]), low = hexValue(text[i + 2]);
      if (high < 0 || low < 0) return std::nullopt;
      out.push_back(static_cast<char>(high << 4 | low));
      i += 2;
    } else if (isPlainTokenByte(c)) {
      out.push_back(static_cast<char>(c));
    } else {
      return std::nullopt;
    }
  }
  return out;
}

std::string lowerHex(const uint8_t* bytes, size_t size) {
  static const char* digits = "0123456789abcdef";
  std::string out;
  out.reserve(size * 2);
  for (size_t i = 0; i < size; i++) {
    out.push_back(digits[bytes[i] >> 4]);
    out.push_back(digits[bytes[i] & 15]);
  }
  return out;
}

// Only the canonical lower-case form is accepted.
bool decodeLowerHex(std::string_view text, uint8_t* out, size_t size) {
  if (text.size() != size * 2) return false;
  for (size_t i = 0; i < size; i++) {
    char h = text[2 * i], l = text[2 * i + 1];
    if ((h >= 'A' && h <= 'F') || (l >= 'A' && l <= 'F')) return false;
    int high = hexValue(h), low = hexValue(l);
    if (high < 0 || low < 0) return false;
    out[i] = static_cast<uint8_t>(high << 4 | low);
  }
  return true;
}

// The audit token as eight words of eight hex digits, word 0 first, so the
// text does not depend on the machine's byte order.
std::string holderText(const QRVAuditToken& token) {
  std::string out;
  out.reserve(kHolderHexLength);
  for (uint32_t word : token.words) out += fmt::format("{:08x}", word);
  return out;
}

std::optional<QRVAuditToken> parseHolder(std::string_view text) {
  if (text.size() != kHolderHexLength) return std::nullopt;
  QRVAuditToken token;
  for (size_t w = 0; w < token.words.size(); w++) {
    uint32_t word = 0;
    for (size_t i = 0; i < 8; i++) {
      char c = text[w * 8 + i];
      int v = hexValue(c);
      if (v < 0 || (c >= 'A' && c <= 'F')) return std::nullopt;
      word = word << 4 | static_cast<uint32_t>(v);
    }
    token.words[w] = word;
  }
  return token;
}

std::optional<int64_t> parseSeconds(std::string_view text) {
  if (text.empty() || text.size() > 18) return std::nullopt;
  int64_t value = 0;
  for (char c : text) {
    if (c < '0' || c > '9') return std::nullopt;
    value = value * 10 + (c - '0');
  }
  return value;
}

int64_t unixSeconds(std::chrono::system_clock::time_point t) {
  return std::chrono::duration_cast<std::chrono::seconds>(t.time_since_epoch()).count();
}

std::optional<QRVLinuxSandbox::Key> createKey(const std::string& path, int* errnum) {
  QRVLinuxSandbox::Key key;
  randombytes_buf(key.data(), key.size());
  // Written whole under a temporary name and linked into place: a reader
  // never sees a partial key, and of two racing creators the first wins.
  const std::string directory = parentDirectory(path);
  if (!ensureDirectory(directory)) {
    *errnum = errno ? errno : ENOTDIR;
    return std::nullopt;
  }
  std::string temporary = path + ".XXXXXX";
  int fd = mkostemp(temporary.data(), O_CLOEXEC);
  if (fd < 0) {
    *errnum = errno;
    return std::nullopt;
  }
  int err = 0;
  if (fchmod(fd, 0600) != 0 || !writeAll(fd, key.data(), key.size()) || fsync(fd) != 0) err = errno ? errno : EIO;
  close(fd);
  if (err == 0 && link(temporary.c_str(), path.c_str()) != 0 && errno != EEXIST) err = errno;
  unlink(temporary.c_str());
  sodium_memzero(key.data(), key.size());
  if (err != 0) {
    *errnum = err;
    return std::nullopt;
  }
  // Whoever won the race, the file now holds the key of this boot.
  return QRVLinuxSandbox::readKey(path, errnum);
}

}  // namespace

QRVLinuxSandbox::QRVLinuxSandbox(Options options)
    : options_(std::move(options)),
      registryQueue_(options_.registryQueue ? options_.registryQueue
                                            : QRVSerialQueue::create("com.kelva.quorvad.sandbox-registry", nullptr,
                                                                     QRVSerialQueue::Priority::kBackground)) {
  if (sodium_init() < 0) QRVLogError("libsodium could not be initialised; extension tokens will fail");
  loadRegistry();
}

QRVLinuxSandbox::~QRVLinuxSandbox() { flushRegistry(); }

bool QRVLinuxSandbox::isSandboxed(const QRVAuditToken& token) {
  // Only the process the token names: a recycled pid is not our peer.
  std::optional<uint64_t> start = QRVProcInfo::startTime(token.pid());
  return start && *start == token.startTime() && QRVProcInfo::isSandboxed(token.pid());
}

// --- Extension tokens --------------------------------------------------------

std::optional<QRVLinuxSandbox::Key> QRVLinuxSandbox::readKey(const std::string& path, int* errnum) {
  int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) {
    *errnum = errno;
    return std::nullopt;
  }
  struct stat st;
  Key key;
  int err = 0;
  if (fstat(fd, &st) != 0) {
    err = errno;
  } else if (!S_ISREG(st.st_mode) || st.st_size != static_cast<off_t>(kKeySize)) {
    err = EINVAL;
  } else if (st.st_uid != geteuid() || (st.st_mode & 077) != 0) {
    // A key anyone else could read or replace seals nothing.
    err = EPERM;
  } else {
    ssize_t n;
    do n = pread(fd, key.data(), key.size(), 0);
    while (n < 0 && errno == EINTR);
    if (n != static_cast<ssize_t>(key.size())) err = n < 0 ? errno : EIO;
  }
  close(fd);
  if (err != 0) {
    *errnum = err;
    return std::nullopt;
  }
  return key;
}

// Not analysed: the first check reads key_ without the lock, which is safe
// because key_ is written once, before keyLoaded_ is released, and never
// again; the analysis sees only the unlocked read.
const QRVLinuxSandbox::Key* QRVLinuxSandbox::key(int* errnum) NO_THREAD_SAFETY_ANALYSIS {
  if (keyLoaded_.load(std::memory_order_acquire)) return &*key_;
  QRVMutexLock lock(&keyMutex_);
  if (keyLoaded_.load(std::memory_order_relaxed)) return &*key_;
  int err = 0;
  std::optional<Key> loaded = readKey(options_.keyPath, &err);
  if (!loaded && err == ENOENT) loaded = createKey(options_.keyPath, &err);
  if (!loaded) {
    QRVLogError("Cannot use the extension key {}: {}", options_.keyPath, strerror(err));
    *errnum = err;
    return nullptr;
  }
  key_ = *loaded;
  keyLoaded_.store(true, std::memory_order_release);
  return &*key_;
}

std::optional<std::string> QRVLinuxSandbox::issueExtension(const std::string& extensionClass,
                                                           const std::string& path, const QRVAuditToken& token,
                                                           int* errnum) {
  int ignored;
  if (!errnum) errnum = &ignored;
  if (extensionClass.empty() || path.empty() || path[0] != '/') {
    *errnum = EINVAL;
    return std::nullopt;
  }
  const Key* sealKey = key(errnum);
  if (!sealKey) return std::nullopt;

  const int64_t expiry = unixSeconds(std::chrono::system_clock::now()) + options_.extensionLifetime.count();
  std::string body = fmt::format("{};{};{};{};{}", kTokenTag, expiry, holderText(token),
                                 percentEncode(extensionClass), percentEncode(path));
  uint8_t mac[crypto_auth_BYTES];
  crypto_auth(mac, reinterpret_cast<const unsigned char*>(body.data()), body.size(), sealKey->data());
  return body + ";" + lowerHex(mac, sizeof mac);
}

QRVLinuxSandbox::Verdict QRVLinuxSandbox::verifyExtension(const std::string& token, const Key& key,
                                                          const QRVAuditToken* holder,
                                                          std::chrono::system_clock::time_point now,
                                                          Extension* out) {
  // The launcher may call this before anything else of libsodium.
  if (sodium_init() < 0) return Verdict::kBadSeal;
  const size_t sealStart = token.rfind(';');
  if (sealStart == std::string::npos) return Verdict::kMalformed;
  uint8_t mac[crypto_auth_BYTES];
  if (!decodeLowerHex(std::string_view(token).substr(sealStart + 1), mac, sizeof mac)) return Verdict::kMalformed;
  if (crypto_auth_verify(mac, reinterpret_cast<const unsigned char*>(token.data()), sealStart, key.data()) != 0)
    return Verdict::kBadSeal;

  // Sealed by us: now read the fields.
  std::vector<std::string_view> fields;
  std::string_view body(token.data(), sealStart);
  for (size_t start = 0;;) {
    size_t end = body.find(';', start);
    fields.push_back(body.substr(start, end == std::string_view::npos ? std::string_view::npos : end - start));
    if (end == std::string_view::npos) break;
    start = end + 1;
  }
  if (fields.size() != 5 || fields[0] != kTokenTag) return Verdict::kMalformed;
  std::optional<int64_t> expiry = parseSeconds(fields[1]);
  std::optional<QRVAuditToken> tokenHolder = parseHolder(fields[2]);
  std::optional<std::string> extensionClass = percentDecode(fields[3]);
  std::optional<std::string> path = percentDecode(fields[4]);
  if (!expiry || !tokenHolder || !extensionClass || !path) return Verdict::kMalformed;

  if (unixSeconds(now) >= *expiry) return Verdict::kExpired;
  if (holder && !(*holder == *tokenHolder)) return Verdict::kWrongHolder;
  if (out) *out = Extension{std::move(*extensionClass), std::move(*path), *tokenHolder, *expiry};
  return Verdict::kValid;
}

// --- User-state items --------------------------------------------------------

int QRVLinuxSandbox::setUserStateItem(const QRVSandboxUserStateItem& item) {
  // Property-list strings end at a NUL: such names could not be published.
  if (item.identifier.empty() || item.identifier.find('\0') != std::string::npos) return EINVAL;
  if (item.path && (item.path->empty() || (*item.path)[0] != '/' || item.path->find('\0') != std::string::npos))
    return EINVAL;

  ItemKey key{item.uid, item.personaID, item.itemType, item.identifier};
  QRVMutexLock lock(&registryMutex_);
  bool changed;
  if (item.path) {
    auto [it, inserted] = mappings_.try_emplace(key, *item.path);
    changed = inserted || it->second != *item.path;
    it->second = *item.path;
  } else {
    changed = mappings_.erase(key) > 0;
  }
  // One write serves every change made before it starts.
  if (changed && !writeScheduled_) {
    writeScheduled_ = true;
    registryQueue_->async([this] { writeRegistry(); });
  }
  return 0;
}

void QRVLinuxSandbox::writeRegistry() {
  std::map<ItemKey, std::string> snapshot;
  {
    QRVMutexLock lock(&registryMutex_);
    snapshot = mappings_;
    // A change from now on needs a write of its own.
    writeScheduled_ = false;
  }
  QRVPlist items = QRVPlist::array();
  for (const auto& [key, path] : snapshot) {
    items.append(QRVPlist::dictionary()
                     .set(kItemUIDKey, QRVPlist::uinteger(std::get<0>(key)))
                     .set(kItemPersonaKey, QRVPlist::uinteger(std::get<1>(key)))
                     .set(kItemTypeKey, QRVPlist::uinteger(std::get<2>(key)))
                     .set(kItemIdentifierKey, QRVPlist::string(std::get<3>(key)))
                     .set(kItemPathKey, QRVPlist::string(path)));
  }
  QRVPlist root = QRVPlist::dictionary();
  root.set(kRegistryVersionKey, QRVPlist::uinteger(kRegistryVersion));
  root.set(kRegistryItemsKey, std::move(items));
  QRVPlist::Bytes bytes = root.toBinary();
  // Root-only: it tells which applications each user has.
  if (int err = writeAtomically(options_.registryPath, bytes.data(), bytes.size(), 0600)) {
    // The mappings stay in memory; the next change writes them all again.
    QRVLogError("Failed to write the sandbox registry {}: {}", options_.registryPath, strerror(err));
    return;
  }
  QRVMutexLock lock(&registryMutex_);
  writeCount_++;
}

void QRVLinuxSandbox::loadRegistry() {
  int fd = open(options_.registryPath.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) return;  // first start of this boot
  QRVPlist::Bytes bytes;
  uint8_t buffer[16384];
  ssize_t n;
  while ((n = read(fd, buffer, sizeof buffer)) > 0 || (n < 0 && errno == EINTR))
    if (n > 0) bytes.insert(bytes.end(), buffer, buffer + n);
  close(fd);
  std::optional<QRVPlist> root = QRVPlist::fromBytes(bytes.data(), bytes.size());
  if (!root || !root->isDictionary() || root->uint64ForKey(kRegistryVersionKey) != kRegistryVersion) {
    QRVLogError("Ignoring unreadable sandbox registry {}", options_.registryPath);
    return;
  }
  QRVMutexLock lock(&registryMutex_);
  for (const QRVPlist& item : root->arrayForKey(kRegistryItemsKey)) {
    const std::string& identifier = item.stringForKey(kItemIdentifierKey);
    const std::string& path = item.stringForKey(kItemPathKey);
    if (identifier.empty() || path.empty() || path[0] != '/') continue;
    mappings_[ItemKey{static_cast<uint32_t>(item.uint64ForKey(kItemUIDKey)),
                      static_cast<uint32_t>(item.uint64ForKey(kItemPersonaKey)), item.uint64ForKey(kItemTypeKey),
                      identifier}] = path;
  }
}

void QRVLinuxSandbox::flushRegistry() { registryQueue_->sync([] {}); }

std::vector<QRVSandboxUserStateItem> QRVLinuxSandbox::userStateItems() const {
  QRVMutexLock lock(&registryMutex_);
  std::vector<QRVSandboxUserStateItem> items;
  for (const auto& [key, path] : mappings_)
    items.push_back({std::get<0>(key), std::get<1>(key), std::get<2>(key), std::get<3>(key), path});
  return items;
}

uint64_t QRVLinuxSandbox::registryWriteCount() const {
  QRVMutexLock lock(&registryMutex_);
  return writeCount_;
}
