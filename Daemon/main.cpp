// quorvad: owns every application's containers on disk.
//
// Usage: quorvad [--root DIR] [--log-level N] [--idle-exit SECONDS]
//   --root DIR        every path the daemon uses lies under DIR (default "/",
//                     or $QUORVAD_ROOT)
//   --log-level N     level of the log file: 5 notice (default), 7 debug
//   --idle-exit S     exit after S seconds without connections or pending
//                     work (for socket activation; default: never)
//   --write-stall-timeout MS
//                     close a client that leaves its replies unread this long
//                     (default 30000)
//   --read-stall-timeout MS
//                     close a client that leaves a frame unfinished this long
//                     (default 30000)
//   --max-connections N
//                     refuse new connections while N are open (default 256)
#include <signal.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

#include "base/QRVLog.h"
#include "core/QRVDaemon.h"
#include "core/QRVExceptionReporter.h"
#include "core/QRVServices.h"
#include "platform/QRVPlatform.h"

namespace {

struct Arguments {
  std::string root = "/";
  int logLevel = QRVLogLevel::kNotice;
  int idleExitSeconds = 0;
  int writeStallMillis = 30'000;
  int readStallMillis = 30'000;
  int maxConnections = 256;
};

[[noreturn]] void usage(const char* problem) {
  if (problem) fprintf(stderr, "quorvad: %s\n", problem);
  fprintf(stderr,
          "usage: quorvad [--root DIR] [--log-level N] [--idle-exit SECONDS] [--write-stall-timeout MS]\n"
          "               [--read-stall-timeout MS] [--max-connections N]\n");
  exit(2);
}

Arguments parseArguments(int argc, char** argv) {
  Arguments a;
  if (const char* env = getenv("QUORVAD_ROOT"); env && *env) a.root = env;
  for (int i = 1; i < argc; i++) {
    std::string arg = argv[i];
    auto value = [&]() -> std::string {
      if (i + 1 >= argc) usage(("missing value for " + arg).c_str());
      return argv[++i];
    };
    if (arg == "--root") {
      a.root = value();
    } else if (arg == "--log-level") {
      a.logLevel = atoi(value().c_str());
    } else if (arg == "--idle-exit") {
      a.idleExitSeconds = atoi(value().c_str());
    } else if (arg == "--write-stall-timeout") {
      a.writeStallMillis = atoi(value().c_str());
    } else if (arg == "--read-stall-timeout") {
      a.readStallMillis = atoi(value().c_str());
    } else if (arg == "--max-connections") {
      a.maxConnections = atoi(value().c_str());
      if (a.maxConnections < 1) usage("--max-connections needs a positive number");
    } else if (arg == "--help" || arg == "-h") {
      usage(nullptr);
    } else {
      usage(("unknown argument " + arg).c_str());
    }
  }
  if (a.root.empty() || a.root[0] != '/') usage("--root needs an absolute path");
  return a;
}

}  // namespace

int main(int argc, char** argv) {
  Arguments args = parseArguments(argc, argv);
  // Replies to a peer that has gone must not kill the daemon.
  signal(SIGPIPE, SIG_IGN);
  QRVSerialQueue::setUncaughtExceptionHandler(QRVReportUncaughtException);
  std::set_terminate([] { QRVReportUncaughtException(std::current_exception()); });

  QRVPlatform::LinuxOptions linuxOptions;
  linuxOptions.writeStallTimeout = std::chrono::milliseconds(std::max(100, args.writeStallMillis));
  linuxOptions.readStallTimeout = std::chrono::milliseconds(std::max(100, args.readStallMillis));
  linuxOptions.maxConnections = static_cast<size_t>(args.maxConnections);
  auto services = QRVServices::make(args.root, QRVPlatform::makeLinux(args.root, linuxOptions));
  QRVDaemon daemon(services, {args.logLevel});
  // Before the log file is open, lines go to stderr (the journal under
  // systemd), which is where a second daemon's complaint belongs.
  if (daemon.start() == QRVDaemon::StartResult::kRootInUse) return 1;
  // Tell systemd we are ready once start-up has run.
  daemon.listenerQueue()->async([] { sd_notify(0, "READY=1"); });

  // The run loop: the daemon's work happens on its queues; the main thread
  // only watches for idleness when asked to exit when idle.
  auto idleSince = std::chrono::steady_clock::now();
  for (;;) {
    std::this_thread::sleep_for(std::chrono::seconds(1));
    if (args.idleExitSeconds <= 0) continue;
    auto now = std::chrono::steady_clock::now();
    if (!services->platform.messages->isIdle()) {
      idleSince = now;
    } else if (now - idleSince >= std::chrono::seconds(args.idleExitSeconds)) {
      QRVLogNotice("idle for {} seconds; exiting", args.idleExitSeconds);
      _exit(0);
    }
  }
}
