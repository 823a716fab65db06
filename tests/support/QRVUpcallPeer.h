// A hand-driven peer of the upcall socket, for tests that must see every
// byte: requests built item by item, sent with exactly the descriptors a
// test names, and replies read back raw and decoded item by item with every
// layout rule checked.
#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <string>
#include <vector>

#include "base/QRVDescriptorPassing.h"
#include "base/QRVUpcallMessage.h"

namespace QRVUpcallPeerSupport {

namespace M = QRVUpcallMessage;

inline constexpr int kAllSeals = F_SEAL_WRITE | F_SEAL_GROW | F_SEAL_SHRINK;

inline void putU32(std::vector<uint8_t>& b, uint32_t v) {
  for (int i = 0; i < 4; i++) b.push_back(static_cast<uint8_t>(v >> (8 * i)));
}
inline void item(std::vector<uint8_t>& b, uint16_t type, uint16_t valueType, uint32_t word) {
  b.push_back(type & 0xff), b.push_back(type >> 8), b.push_back(valueType & 0xff), b.push_back(valueType >> 8);
  putU32(b, word);
}
// A string item; `nul` false leaves the terminating NUL out (hostile).
inline void str(std::vector<uint8_t>& b, uint16_t valueType, const std::string& s, bool nul = true) {
  item(b, 2, valueType, static_cast<uint32_t>(s.size() + (nul ? 1 : 0)));
  b.insert(b.end(), s.begin(), s.end());
  if (nul) b.push_back(0);
  while (b.size() % 8) b.push_back(0);
}
inline void end(std::vector<uint8_t>& b) { item(b, 0, 0, 0); }

// A memory file holding `bytes`, sealed with `seals`.
inline int memfd(const std::vector<uint8_t>& bytes, int seals = kAllSeals) {
  int fd = memfd_create("upcall-test", MFD_CLOEXEC | MFD_ALLOW_SEALING);
  EXPECT_EQ(write(fd, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
  if (seals) {
    EXPECT_EQ(fcntl(fd, F_ADD_SEALS, seals), 0);
  }
  return fd;
}

inline std::vector<uint8_t> request(uint32_t size, uint32_t id = M::kGetProcessContainersID) {
  return M::encodeRequest(id, size);
}

// One decoded reply item, read straight from the bytes.
struct Item {
  uint16_t valueType;
  std::string text;  // strings, without the NUL
  uint32_t value = 0;
};
// Reads every item up to the end item, checking the layout on the way: 8-byte
// headers, lengths that count the NUL, zero padding, the end item last.
inline std::vector<Item> items(const std::vector<uint8_t>& b) {
  std::vector<Item> out;
  size_t at = 0;
  for (;;) {
    EXPECT_LE(at + 8, b.size());
    if (at + 8 > b.size()) return out;
    uint16_t type = b[at] | (b[at + 1] << 8);
    uint16_t valueType = b[at + 2] | (b[at + 3] << 8);
    uint32_t word = b[at + 4] | (b[at + 5] << 8) | (b[at + 6] << 16) | (static_cast<uint32_t>(b[at + 7]) << 24);
    at += 8;
    if (type == 0) {
      EXPECT_EQ(valueType, 0);
      EXPECT_EQ(word, 0u);
      EXPECT_EQ(at, b.size()) << "bytes after the end item";
      return out;
    }
    if (type == 1) {
      out.push_back({valueType, "", word});
      continue;
    }
    EXPECT_EQ(type, 2) << "only strings and inline values are expected";
    EXPECT_GE(word, 1u);
    EXPECT_LE(at + word, b.size());
    if (type != 2 || word == 0 || at + word > b.size()) return out;
    EXPECT_EQ(b[at + word - 1], 0) << "string without its NUL";
    out.push_back({valueType, std::string(reinterpret_cast<const char*>(&b[at]), word - 1)});
    size_t padded = (word + 7) / 8 * 8;
    for (size_t i = word; i < padded; i++) EXPECT_EQ(b[at + i], 0) << "padding not zero";
    at += padded;
  }
}

// A peer of the upcall socket that sends exactly what a test says.
class Peer {
 public:
  explicit Peer(const std::string& path) {
    fd_ = socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
    sockaddr_un a{};
    a.sun_family = AF_UNIX;
    strncpy(a.sun_path, path.c_str(), sizeof a.sun_path - 1);
    EXPECT_EQ(connect(fd_, reinterpret_cast<sockaddr*>(&a), sizeof a), 0) << strerror(errno);
  }
  ~Peer() { close(fd_); }
  // Sends `message` with `fds` (closed here after sending). Up to one goes
  // through the shared helper; more are attached by hand.
  void send(const std::vector<uint8_t>& message, std::vector<int> fds = {}) {
    if (fds.size() <= 1) {
      EXPECT_GE(QRVDescriptorPassing::send(fd_, message, fds.empty() ? -1 : fds[0], 0), 0) << strerror(errno);
    } else {
      iovec iov{const_cast<uint8_t*>(message.data()), message.size()};
      std::vector<char> control(CMSG_SPACE(sizeof(int) * fds.size()));
      msghdr msg{};
      msg.msg_iov = &iov;
      msg.msg_iovlen = 1;
      msg.msg_control = control.data();
      msg.msg_controllen = control.size();
      cmsghdr* c = CMSG_FIRSTHDR(&msg);
      c->cmsg_level = SOL_SOCKET;
      c->cmsg_type = SCM_RIGHTS;
      c->cmsg_len = CMSG_LEN(sizeof(int) * fds.size());
      memcpy(CMSG_DATA(c), fds.data(), sizeof(int) * fds.size());
      EXPECT_GE(sendmsg(fd_, &msg, MSG_NOSIGNAL), 0) << strerror(errno);
    }
    for (int fd : fds) close(fd);
  }
  struct Reply {
    std::vector<uint8_t> message;
    std::vector<uint8_t> region;  // the reply's memory, when one came
    int seals = -1;
    int regions = 0;
  };
  Reply receive() {
    Reply r;
    pollfd p{fd_, POLLIN, 0};
    EXPECT_EQ(poll(&p, 1, 10'000), 1) << "no reply";
    r.message.resize(128);
    std::vector<int> fds;
    ssize_t n = QRVDescriptorPassing::receive(fd_, r.message.data(), r.message.size(), 0, &fds, nullptr);
    r.message.resize(n > 0 ? n : 0);
    for (int fd : fds) {
      struct stat st;
      fstat(fd, &st);
      r.regions++;
      r.seals = fcntl(fd, F_GET_SEALS);
      r.region.resize(st.st_size);
      EXPECT_EQ(pread(fd, r.region.data(), r.region.size(), 0), st.st_size);
      close(fd);
    }
    return r;
  }
  // The return code of an error reply to `id`, or 0 for a reply with items.
  int32_t exchange(const std::vector<uint8_t>& message, std::vector<int> fds = {},
                   uint32_t id = M::kGetProcessContainersID) {
    send(message, std::move(fds));
    Reply r = receive();
    auto header = M::decodeHeader(r.message.data(), r.message.size());
    EXPECT_TRUE(header && header->id == id + 100);
    return M::decodeReturnCode(r.message.data(), r.message.size()).value_or(0);
  }

 private:
  int fd_ = -1;
};

// The items of a reply with paths, once its message has been checked: a
// complex reply of the message size to the process-containers request, with
// one sealed region of the size its descriptor gives.
inline std::vector<Item> replyItems(const Peer::Reply& r) {
  auto reply = M::decodeComplex(r.message.data(), r.message.size());
  EXPECT_TRUE(reply) << r.message.size() << " bytes";
  if (!reply) return {};
  EXPECT_EQ(reply->header.bits & M::kComplex, M::kComplex);
  EXPECT_EQ(reply->header.size, M::kMessageSize);
  EXPECT_EQ(reply->header.id, M::kGetProcessContainersID + 100);
  EXPECT_EQ(reply->descriptorCount, 1u);
  EXPECT_EQ(reply->descriptorSize, reply->count);
  EXPECT_EQ(reply->descriptorSize, r.region.size());
  EXPECT_EQ(r.regions, 1);
  EXPECT_EQ(r.seals & kAllSeals, kAllSeals);
  return items(r.region);
}

// The value types of `items`, in order.
inline std::vector<uint16_t> valueTypes(const std::vector<Item>& items) {
  std::vector<uint16_t> types;
  for (const Item& i : items) types.push_back(i.valueType);
  return types;
}

}  // namespace QRVUpcallPeerSupport
