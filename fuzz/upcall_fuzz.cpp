// Feeds the upcall server's request handling what reaches it after the
// transport: the bytes of a request's memory region, read as packed-buffer
// items (every item type, hostile lengths, repeated items, a missing end
// item). Each input runs against daemon services on one temporary root.
//
// What must hold whatever the bytes: the routine ends with one of its
// statuses (0, 4, 5, 9); a reply (status 0) is a well-formed packed buffer
// whose items come in the reply's order, every path lies inside the root,
// and the status item comes last; nothing outside the input is read (the
// input is copied to a buffer of exactly its size, so the sanitizer sees any
// read beyond it).
#include <cstdio>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "base/QRVLog.h"
#include "base/QRVUpcallMessage.h"
#include "packbuff/packbuff.h"
#include "support/QRVTestServices.h"
#include "upcall/QRVProcessContainers.h"

namespace M = QRVUpcallMessage;

namespace {

void check(bool ok, const char* what, const std::string& detail = {}) {
  if (ok) return;
  fprintf(stderr, "upcall_fuzz: %s %s\n", what, detail.c_str());
  __builtin_trap();
}

struct Environment {
  QRVTestServices services;
  std::unique_ptr<QRVProcessContainers> containers;
  Environment() {
    // Errors are the expected outcome of most inputs; keep them out of the
    // fuzzer's output.
    QRVLog::open("com.kelva.quorvad.fuzz", services.root.path() + "/fuzz.log", QRVLogLevel::kError, 1, 1 << 20);
    containers = std::make_unique<QRVProcessContainers>(services.services);
  }
};

// The order in which reply items may come: each one's rank.
int rank(uint16_t valueType) {
  switch (valueType) {
    case M::kReplyHomeDirectory:
      return 0;
    case M::kReplyDataContainer:
      return 1;
    case M::kReplyTempDirectory:
      return 2;
    case M::kReplyAppGroupID:
    case M::kReplyAppGroupPath:
      return 3;
    case M::kReplySystemContainer:
      return 4;
    case M::kReplySystemGroupID:
    case M::kReplySystemGroupPath:
      return 5;
    default:
      return -1;
  }
}

void checkReply(const std::vector<uint8_t>& reply, const std::string& root) {
  check(!reply.empty() && reply.size() % 8 == 0, "reply size");
  sb_packbuff* pb =
      sb_packbuff_init_with_buffer(const_cast<uint8_t*>(reply.data()), reply.size(), true, SB_PACKBUFF_DEALLOC_NONE);
  check(pb != nullptr, "reply not wrapped");
  int last = 0;
  bool status = false;
  uint16_t type = 0;
  while (sb_packbuff_get_item_value_type(pb, &type)) {
    check(!status, "item after the status");
    int error = 0;
    if (type == M::kReplyStatus) {
      uint32_t value = sb_packbuff_unpack_uint32(pb, &error);
      check(error == 0 && value <= 1, "status item");
      status = true;
      continue;
    }
    check(rank(type) >= last, "reply items out of order", std::to_string(type));
    last = rank(type);
    size_t length = 0;
    const char* text = sb_packbuff_unpack_string(pb, &length, &error);
    check(text != nullptr, "unreadable reply string", std::to_string(type));
    // Keys are identifiers; every other string is a path inside the root.
    if (type != M::kReplyAppGroupID && type != M::kReplySystemGroupID)
      check(std::string(text).rfind(root + "/", 0) == 0 && std::string(text).find("/../") == std::string::npos,
            "path outside the root", text);
  }
  check(status, "no status item");
  sb_packbuff_free(pb);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static Environment* environment = new Environment();
  // Exactly the input's bytes: a read beyond them is a heap overflow.
  std::unique_ptr<uint8_t[]> bytes(size ? new uint8_t[size] : nullptr);
  if (size) memcpy(bytes.get(), data, size);
  std::vector<uint8_t> reply;
  int32_t status = environment->containers->replyForRequest(bytes.get(), size, &reply);
  check(status == 0 || status == M::kStatusBadRequest || status == M::kStatusUnreadable ||
            status == M::kStatusNoReplyBuffer,
        "unexpected status", std::to_string(status));
  if (status == 0) checkReply(reply, environment->services.root.path());
  return 0;
}
