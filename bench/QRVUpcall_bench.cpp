// What one upcall costs a launcher, against the same lookups through the
// command service and against the bare transport.
//
// A whole daemon runs in this process on a temporary root (the test fakes
// for everything but the two sockets, which are the real ones), and the
// benchmark is its client. Measured in the same run, round-robin, over one
// connection each:
//  - upcall: one request naming a data container and two app groups, and its
//    reply with home, data, tmp, two group pairs and the status;
//  - commands: the same three paths through command 0 (the data container)
//    and command 13 (the owner's two app groups), two round trips;
//  - echo: the upcall transport with a handler that sends the request's
//    packed buffer straight back, the floor of any upcall.
// Prints round trips per second and p50/p99 latency of each.
//
//   QRVUpcall_bench [rounds]      default 2,000
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "base/QRVDescriptorPassing.h"
#include "base/QRVLog.h"
#include "base/QRVUpcallMessage.h"
#include "client/QRVContainerClient.h"
#include "client/QRVUpcallClient.h"
#include "codesigning/QRVCodeSigningMapping.h"
#include "core/QRVCommandQueue.h"
#include "core/QRVCommandTable.h"
#include "core/QRVDaemon.h"
#include "platform/linux/QRVLinuxMessageService.h"
#include "platform/linux/QRVLinuxUpcallTransport.h"
#include "support/QRVTestServices.h"

using Clock = std::chrono::steady_clock;

namespace {

struct Figures {
  const char* name;
  std::vector<double> micros;
  void print() {
    std::sort(micros.begin(), micros.end());
    double total = 0;
    for (double m : micros) total += m;
    printf("%-9s %9.0f round trips/s   p50 %7.1f us   p99 %7.1f us\n", name, micros.size() / (total / 1e6),
           micros[micros.size() / 2], micros[micros.size() * 99 / 100]);
  }
};

// One exchange with the echo handler, as the upcall client makes it: the
// items into a sealed memory file, the message and the file out, the answer
// and its file in, the file read.
bool echoExchange(int fd, const std::vector<uint8_t>& items) {
  int region = QRVDescriptorPassing::makeSealedMemory("bench-echo", items);
  bool sent = region >= 0 &&
              QRVDescriptorPassing::send(fd, QRVUpcallMessage::encodeRequest(1, static_cast<uint32_t>(items.size())),
                                         region, 0) > 0;
  if (region >= 0) close(region);
  uint8_t reply[64];
  std::vector<int> fds;
  ssize_t n = sent ? QRVDescriptorPassing::receive(fd, reply, sizeof reply, 0, &fds, nullptr) : -1;
  std::vector<uint8_t> echoed(items.size());
  bool ok = n == static_cast<ssize_t>(QRVUpcallMessage::kMessageSize) && fds.size() == 1 &&
            pread(fds[0], echoed.data(), echoed.size(), 0) == static_cast<ssize_t>(echoed.size()) && echoed == items;
  for (int f : fds) close(f);
  return ok;
}

template <typename F>
void timeOnce(Figures& f, F&& body) {
  auto begin = Clock::now();
  if (!body()) {
    fprintf(stderr, "%s failed\n", f.name);
    exit(1);
  }
  f.micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - begin).count());
}

}  // namespace

int main(int argc, char** argv) {
  const int rounds = argc > 1 ? atoi(argv[1]) : 2000;
  QRVTestServices env;
  QRVLog::open("com.kelva.quorvad.bench", env.root.path() + "/bench.log", QRVLogLevel::kError, 1, 1 << 20);
  const std::string root = env.root.path();
  QRVLinuxMessageService::Options messageOptions;
  messageOptions.socketPath = root + "/run/quorvad/com.kelva.quorvad";
  env.services->platform.messages = std::make_shared<QRVLinuxMessageService>(messageOptions);
  env.services->platform.upcall =
      std::make_shared<QRVLinuxUpcallTransport>(QRVLinuxUpcallTransport::Options{root + "/run/quorvad/com.kelva.quorvad.upcall", {}, 64});
  // This process is the command service's client: an unrestricted one.
  env.trustStore->setClient(getpid(), {"com.example.bench.client",
                                       QRVPlist::dictionary().set(kEntitlementAllowed, QRVPlist::boolean(true))});
  // The application claims the two groups it is asked about.
  const std::string app = "com.example.bench.app";
  QRVPlist groups = QRVPlist::array();
  groups.append(QRVPlist::string("group.com.example.bench.one"));
  groups.append(QRVPlist::string("group.com.example.bench.two"));
  QRVCommandQueue queue;
  env.services->codeSigningMapping->processCodeSigningInfo(
      QRVPlist::dictionary().set(kQRVCodeSigningEntitlementsKey,
                                 QRVPlist::dictionary().set(kQRVApplicationGroupsEntitlement, groups)),
      app, QRVPlist::dictionary().set(kQRVDataContainerClassOption, QRVPlist::uinteger(2)), queue);

  QRVDaemon daemon(env.services, {});
  if (daemon.start() != QRVDaemon::StartResult::kServing) return 1;
  daemon.listenerQueue()->sync([] {});  // start-up has run

  // The floor: the same transport, answering with the request's own bytes.
  auto echoQueue = QRVSerialQueue::create("bench.echo");
  QRVLinuxUpcallTransport echo({root + "/run/echo.upcall", {}, 64});
  QRVError error;
  echo.checkIn(
      "bench.echo", echoQueue,
      [](QRVUpcallRequest& request) -> std::optional<QRVUpcallReply> {
        auto c = QRVUpcallMessage::decodeComplex(request.message().data(), request.message().size());
        auto header = QRVUpcallMessage::decodeHeader(request.message().data(), request.message().size());
        auto region = c ? request.mapRegion(c->descriptorSize, nullptr) : nullptr;
        if (!region) return QRVUpcallReply{QRVUpcallMessage::encodeErrorReply(*header, -300), std::nullopt};
        std::vector<uint8_t> bytes(region->bytes(), region->bytes() + region->size());
        return QRVUpcallReply{QRVUpcallMessage::encodeReply(*header, static_cast<uint32_t>(bytes.size())),
                              std::move(bytes)};
      },
      &error);

  QRVClientError clientError;
  auto upcall = QRVUpcallClient::connect(root, &clientError);
  auto commands = QRVClient::connect(root, &clientError);
  int echoFd = QRVClient::connectUnixSocket(root + "/run/echo.upcall", SOCK_SEQPACKET, &clientError);
  if (!upcall || !commands || echoFd < 0) {
    fprintf(stderr, "cannot connect: %s\n", clientError.message.c_str());
    return 1;
  }
  QRVContainerClient containers(std::move(*commands));
  QRVUpcallProcess process;
  process.codeSigningIdentifier = app;
  process.uid = 501;
  process.appGroupIdentifiers = {"group.com.example.bench.one", "group.com.example.bench.two"};
  std::vector<uint8_t> items = *QRVUpcallClient::packRequest(process, nullptr);

  Figures upcallFigures{"upcall", {}}, commandFigures{"commands", {}}, echoFigures{"echo", {}};
  const auto timeout = std::chrono::seconds(30);
  for (int i = -50; i < rounds; i++) {  // the first 50 warm up
    Figures scratch{"warm-up", {}};
    timeOnce(i < 0 ? scratch : upcallFigures, [&] {
      auto a = upcall->ask(process, timeout, &clientError);
      return a && a->returnCode == 0 && a->containers.complete && a->containers.appGroups.size() == 2;
    });
    timeOnce(i < 0 ? scratch : commandFigures, [&] {
      auto data = containers.createOrLookupContainer({.identifier = app, .containerClass = 2, .persona = std::nullopt, .uuid = std::nullopt}, true, false,
                                                     &clientError);
      auto g = containers.createOrLookupGroupContainers({.owner = app, .groupClass = 7, .persona = std::nullopt}, &clientError);
      return data && data->code == 1 && g && g->code == 1 && g->groupPaths.size() == 2;
    });
    timeOnce(i < 0 ? scratch : echoFigures, [&] { return echoExchange(echoFd, items); });
  }
  close(echoFd);
  upcallFigures.print();
  commandFigures.print();
  echoFigures.print();
  return 0;
}
