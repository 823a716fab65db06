#include "client/QRVUpcallClient.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <memory>

#include "base/QRVDescriptorPassing.h"
#include "base/QRVUpcallMessage.h"
#include "packbuff/packbuff.h"

namespace M = QRVUpcallMessage;

namespace {

struct PackbuffDeleter {
  void operator()(sb_packbuff* pb) const { sb_packbuff_free(pb); }
};
using Packbuff = std::unique_ptr<sb_packbuff, PackbuffDeleter>;

class Descriptor {
 public:
  explicit Descriptor(int fd = -1) : fd_(fd) {}
  Descriptor(const Descriptor&) = delete;
  Descriptor& operator=(const Descriptor&) = delete;
  ~Descriptor() {
    if (fd_ >= 0) close(fd_);
  }
  int get() const { return fd_; }

 private:
  int fd_;
};

bool fail(QRVClientError* error, int errnum, std::string message) {
  if (error) *error = {errnum, std::move(message)};
  return false;
}

// The reply's region: at least `size` bytes of a sealed memory file.
bool readRegion(int fd, uint32_t size, std::vector<uint8_t>* out, QRVClientError* error) {
  constexpr int kSeals = QRVDescriptorPassing::kContentSeals;
  int seals = fcntl(fd, F_GET_SEALS);
  struct stat st;
  if (seals < 0 || (seals & kSeals) != kSeals || fstat(fd, &st) != 0 || static_cast<uint64_t>(st.st_size) < size)
    return fail(error, EBADMSG, "the daemon's reply region is not sealed memory of the size it claims");
  out->resize(size);
  size_t done = 0;
  while (done < size) {
    ssize_t n = pread(fd, out->data() + done, size - done, static_cast<off_t>(done));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return fail(error, EBADMSG, "the daemon's reply region cannot be read");
    done += static_cast<size_t>(n);
  }
  return true;
}

}  // namespace

QRVPlist QRVUpcallContainers::plist() const {
  QRVPlist d = QRVPlist::dictionary();
  auto setPath = [&](const char* key, const std::optional<std::string>& path) {
    if (path) d.set(key, QRVPlist::string(*path));
  };
  auto pairs = [](const std::vector<std::pair<std::string, std::string>>& list) {
    QRVPlist p = QRVPlist::dictionary();
    for (const auto& [identifier, path] : list) p.set(identifier, QRVPlist::string(path));
    return p;
  };
  setPath("HomeDirectory", homeDirectory);
  setPath("DataContainer", dataContainer);
  setPath("TempDirectory", tempDirectory);
  if (!appGroups.empty()) d.set("AppGroups", pairs(appGroups));
  setPath("SystemContainer", systemContainer);
  if (!systemGroups.empty()) d.set("SystemGroups", pairs(systemGroups));
  d.set("Complete", QRVPlist::boolean(complete));
  return d;
}

std::string QRVUpcallClient::socketPathForRoot(const std::string& root) {
  return QRVClient::socketPathForRoot(root) + ".upcall";
}

std::optional<QRVUpcallClient> QRVUpcallClient::connect(const std::string& root, QRVClientError* error) {
  int fd = QRVClient::connectUnixSocket(socketPathForRoot(root), SOCK_SEQPACKET, error);
  if (fd < 0) return std::nullopt;
  return QRVUpcallClient(fd);
}

std::optional<QRVUpcallAnswer> QRVUpcallClient::ask(const std::string& root, const QRVUpcallProcess& process,
                                                    std::chrono::milliseconds timeout, QRVClientError* error) {
  std::optional<QRVUpcallClient> client = connect(root, error);
  if (!client) return std::nullopt;
  return client->ask(process, timeout, error);
}

QRVUpcallClient::~QRVUpcallClient() {
  if (fd_ >= 0) close(fd_);
}

std::optional<QRVUpcallAnswer> QRVUpcallClient::ask(const QRVUpcallProcess& process,
                                                    std::chrono::milliseconds timeout, QRVClientError* error) {
  std::optional<std::vector<uint8_t>> items = packRequest(process, error);
  if (!items) return std::nullopt;
  return askWithItems(*items, M::kGetProcessContainersID, timeout, error);
}

std::optional<QRVUpcallAnswer> QRVUpcallClient::askWithItems(const std::vector<uint8_t>& items, uint32_t messageId,
                                                             std::chrono::milliseconds timeout,
                                                             QRVClientError* error) {
  // The items go in a memory file sealed before it is sent: the daemon
  // refuses any it could see change.
  Descriptor region(QRVDescriptorPassing::makeSealedMemory("quorva-upcall-request", items));
  if (region.get() < 0) {
    int e = errno;
    fail(error, e, fmt::format("cannot prepare the request's memory: {}", strerror(e)));
    return std::nullopt;
  }
  std::vector<uint8_t> message = M::encodeRequest(messageId, static_cast<uint32_t>(items.size()));
  if (QRVDescriptorPassing::send(fd_, message, region.get(), 0) < 0) {
    int e = errno;
    fail(error, e == EPIPE ? ECONNRESET : e, fmt::format("cannot send the upcall request: {}", strerror(e)));
    return std::nullopt;
  }

  pollfd p{fd_, POLLIN, 0};
  int timeoutMs = timeout >= std::chrono::hours(24 * 365) ? -1 : static_cast<int>(timeout.count());
  int ready;
  while ((ready = poll(&p, 1, timeoutMs)) < 0 && errno == EINTR) {
  }
  if (ready == 0) {
    fail(error, ETIMEDOUT, "quorvad did not answer the upcall in time");
    return std::nullopt;
  }
  uint8_t reply[M::kMessageSize + 8];
  std::vector<int> fds;
  ssize_t n = QRVDescriptorPassing::receive(fd_, reply, sizeof reply, 0, &fds, nullptr);
  std::vector<std::unique_ptr<Descriptor>> regions;
  for (int fd : fds) regions.push_back(std::make_unique<Descriptor>(fd));
  if (n <= 0) {
    fail(error, n == 0 ? ECONNRESET : errno, "quorvad closed the upcall connection without an answer");
    return std::nullopt;
  }
  std::optional<M::Header> header = M::decodeHeader(reply, static_cast<size_t>(n));
  if (!header || header->id != messageId + M::kReplyIDOffset) {
    fail(error, EBADMSG, "quorvad's upcall reply does not answer the request");
    return std::nullopt;
  }
  QRVUpcallAnswer answer;
  if (std::optional<int32_t> code = M::decodeReturnCode(reply, static_cast<size_t>(n))) {
    answer.returnCode = *code;
    return answer;
  }
  std::optional<M::Complex> complex = M::decodeComplex(reply, static_cast<size_t>(n));
  std::vector<uint8_t> replyItems;
  if (!complex || complex->descriptorCount != 1 || complex->descriptorSize != complex->count ||
      regions.size() != 1) {
    fail(error, EBADMSG, "quorvad's upcall reply is malformed");
    return std::nullopt;
  }
  if (!readRegion(regions[0]->get(), complex->descriptorSize, &replyItems, error)) return std::nullopt;
  std::optional<QRVUpcallContainers> containers = decodeReply(replyItems.data(), replyItems.size(), error);
  if (!containers) return std::nullopt;
  answer.containers = std::move(*containers);
  return answer;
}

const char* QRVUpcallClient::returnCodeMeaning(int32_t code) {
  switch (code) {
    case 0:
      return "answered";
    case M::kTypeError:
      return "malformed request";
    case M::kBadID:
      return "unknown message id";
    case M::kTrailerError:
      return "no sender credentials";
    case M::kStatusBadRequest:
      return "bad request, or no user identity for the persona";
    case M::kStatusUnreadable:
      return "an item could not be read";
    case M::kStatusNoReplyBuffer:
      return "no reply buffer";
    case M::kNotEntitled:
      return "caller not entitled";
    default:
      return "unknown return code";
  }
}

std::optional<std::vector<uint8_t>> QRVUpcallClient::packRequest(const QRVUpcallProcess& process,
                                                                 QRVClientError* error) {
  Packbuff pb(sb_packbuff_new(1024));
  if (!pb) {
    fail(error, ENOMEM, "cannot make the upcall request buffer");
    return std::nullopt;
  }
  int e = 0;
  auto string = [&](uint16_t type, const std::string& value) {
    if (e == 0) e = sb_packbuff_pack_string(pb.get(), type, value.c_str(), value.size());
  };
  auto number = [&](uint16_t type, const std::optional<uint32_t>& value) {
    if (e == 0 && value) e = sb_packbuff_pack_uint32(pb.get(), type, *value);
  };
  if (process.codeSigningIdentifier) string(M::kRequestCodeSignatureID, *process.codeSigningIdentifier);
  if (process.containerIdentifier) string(M::kRequestContainerID, *process.containerIdentifier);
  if (process.applicationIdentifier) string(M::kRequestApplicationID, *process.applicationIdentifier);
  number(M::kRequestUID, process.uid);
  for (const std::string& group : process.appGroupIdentifiers) string(M::kRequestAppGroupID, group);
  number(M::kRequestContainerType, process.containerType);
  if (process.systemContainerIdentifier) string(M::kRequestSystemContainerID, *process.systemContainerIdentifier);
  for (const std::string& group : process.systemGroupIdentifiers) string(M::kRequestSystemGroupContainerID, group);
  number(M::kRequestPersonaID, process.personaID);
  if (e != 0) {
    fail(error, e, fmt::format("cannot pack the upcall request: {}", strerror(e)));
    return std::nullopt;
  }
  const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb.get()));
  return std::vector<uint8_t>(bytes, bytes + sb_packbuff_get_size(pb.get()));
}

std::optional<QRVUpcallContainers> QRVUpcallClient::decodeReply(const uint8_t* bytes, size_t length,
                                                                QRVClientError* error) {
  auto broken = [&](const std::string& what) -> std::optional<QRVUpcallContainers> {
    fail(error, EBADMSG, "quorvad's upcall reply is malformed: " + what);
    return std::nullopt;
  };
  Packbuff pb(length > 0 ? sb_packbuff_init_with_buffer(const_cast<uint8_t*>(bytes), length, true,
                                                        SB_PACKBUFF_DEALLOC_NONE)
                         : nullptr);
  if (!pb) return broken("no items");
  QRVUpcallContainers containers;
  bool sawStatus = false;
  uint16_t type = 0;
  while (sb_packbuff_get_item_value_type(pb.get(), &type)) {
    if (sawStatus) return broken("items after the status");
    int e = 0;
    if (type == M::kReplyStatus) {
      containers.complete = sb_packbuff_unpack_uint32(pb.get(), &e) == 1;
      if (e != 0) return broken("unreadable status");
      sawStatus = true;
      continue;
    }
    if (type == M::kReplyAppGroupID || type == M::kReplySystemGroupID) {
      const char* key = nullptr;
      const char* value = nullptr;
      uint16_t valueType = 0;
      if (sb_packbuff_unpack_key_with_string_value(pb.get(), &key, &valueType, &value, nullptr) != 0 ||
          valueType != type + 1)
        return broken("unreadable group pair");
      (type == M::kReplyAppGroupID ? containers.appGroups : containers.systemGroups).emplace_back(key, value);
      continue;
    }
    size_t n = 0;
    const char* path = sb_packbuff_unpack_string(pb.get(), &n, &e);
    if (!path) return broken(fmt::format("unreadable item of type {}", type));
    switch (type) {
      case M::kReplyHomeDirectory:
        containers.homeDirectory = path;
        break;
      case M::kReplyDataContainer:
        containers.dataContainer = path;
        break;
      case M::kReplyTempDirectory:
        containers.tempDirectory = path;
        break;
      case M::kReplySystemContainer:
        containers.systemContainer = path;
        break;
      default:
        return broken(fmt::format("unknown item type {}", type));
    }
  }
  if (!sawStatus) return broken("no status");
  return containers;
}
