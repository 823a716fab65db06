// The launcher's side of the kernel container-path service: asks quorvad for
// every container path of a process it is about to start, in one exchange
// over "<root>/run/quorvad/com.kelva.quorvad.upcall".
//
// Usage:
//   QRVUpcallProcess process;
//   process.codeSigningIdentifier = "com.example.app";
//   process.uid = 501;
//   process.appGroupIdentifiers = {"group.com.example"};
//   QRVClientError error;
//   auto answer = QRVUpcallClient::ask(QRVClient::resolveRoot(std::nullopt), process, timeout, &error);
//   if (answer && answer->returnCode == 0) use(answer->containers);
//
// Only root and programs whose trust-store entry holds the entitlement
// "com.kelva.private.Quorva.kernelUpcall" are answered; anyone else gets
// return code 55.
//
// Thread-safety: one QRVUpcallClient per thread; no process-wide state.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "base/QRVPlist.h"
#include "client/QRVClient.h"

// A process as the launcher describes it. Absent items are not sent: the
// daemon then takes uid 0, container type 0 (application) and no persona.
struct QRVUpcallProcess {
  std::optional<std::string> codeSigningIdentifier;
  // The data container's identifier, when it is not the code-signing one.
  std::optional<std::string> containerIdentifier;
  std::optional<std::string> applicationIdentifier;
  std::optional<uint32_t> uid;
  // 0 application, 1 plug-in.
  std::optional<uint32_t> containerType;
  // The kernel persona id; 0xFFFFFFFF for none.
  std::optional<uint32_t> personaID;
  std::vector<std::string> appGroupIdentifiers;
  std::optional<std::string> systemContainerIdentifier;
  std::vector<std::string> systemGroupIdentifiers;
};

// The paths of the reply; what the daemon did not send stays empty.
struct QRVUpcallContainers {
  std::optional<std::string> homeDirectory;
  std::optional<std::string> dataContainer;
  std::optional<std::string> tempDirectory;
  std::vector<std::pair<std::string, std::string>> appGroups;  // identifier, path
  std::optional<std::string> systemContainer;
  std::vector<std::pair<std::string, std::string>> systemGroups;
  // The final status item: every lookup succeeded.
  bool complete = false;

  // As a dictionary for printing: "HomeDirectory", "DataContainer",
  // "TempDirectory", "AppGroups" and "SystemGroups" (identifier -> path),
  // "SystemContainer", "Complete".
  QRVPlist plist() const;
};

struct QRVUpcallAnswer {
  // 0 when the daemon answered with paths; otherwise its return code (55 not
  // entitled, 4 bad request or unknown persona, 5 unreadable item, -300
  // malformed message, -303 unknown id, -309 no credentials).
  int32_t returnCode = 0;
  QRVUpcallContainers containers;
};

class QRVUpcallClient {
 public:
  // "<root>/run/quorvad/com.kelva.quorvad.upcall".
  static std::string socketPathForRoot(const std::string& root);

  // Connects once; the connection serves any number of asks.
  static std::optional<QRVUpcallClient> connect(const std::string& root, QRVClientError* error);
  // Connects, asks once, disconnects.
  static std::optional<QRVUpcallAnswer> ask(const std::string& root, const QRVUpcallProcess& process,
                                            std::chrono::milliseconds timeout, QRVClientError* error);

  QRVUpcallClient(QRVUpcallClient&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  QRVUpcallClient& operator=(QRVUpcallClient&& other) noexcept {
    std::swap(fd_, other.fd_);
    return *this;
  }
  ~QRVUpcallClient();

  // Sends the request for `process` and waits at most `timeout` for the
  // answer. Nothing (with `error`) when the exchange itself fails: EBADMSG
  // for a reply that is not one (wrong size or id, a region missing or
  // malformed), ECONNRESET when the daemon closed the connection.
  std::optional<QRVUpcallAnswer> ask(const QRVUpcallProcess& process, std::chrono::milliseconds timeout,
                                     QRVClientError* error);
  // The same for request bytes packed by the caller, sent under message id
  // `messageId` (tests and benchmarks).
  std::optional<QRVUpcallAnswer> askWithItems(const std::vector<uint8_t>& items, uint32_t messageId,
                                              std::chrono::milliseconds timeout, QRVClientError* error);

  // A few words on an answer's return code, for people.
  static const char* returnCodeMeaning(int32_t code);

  // The request items for `process`, as a packed buffer.
  static std::optional<std::vector<uint8_t>> packRequest(const QRVUpcallProcess& process, QRVClientError* error);
  // The reply items; nothing (EBADMSG) when they break the format.
  static std::optional<QRVUpcallContainers> decodeReply(const uint8_t* bytes, size_t length, QRVClientError* error);

  int fd() const { return fd_; }

 private:
  explicit QRVUpcallClient(int fd) : fd_(fd) {}
  int fd_ = -1;
};
