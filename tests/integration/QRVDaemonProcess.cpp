#include "integration/QRVDaemonProcess.h"

#include <semaphore.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>
#include <utility>

#include "client/QRVClient.h"
#include "platform/linux/QRVLinuxFirstBootMarker.h"

QRVDaemonProcess::QRVDaemonProcess() {
  std::string pattern = (std::filesystem::temp_directory_path() / "quorvad-it-XXXXXX").string();
  if (!mkdtemp(pattern.data())) abort();
  root_ = pattern;
  chmod(root_.c_str(), 0755);
  std::string command = std::string("bash '") + QUORVAD_SOURCE_DIR "/scripts/prepare-root.sh' '" + root_ + "' >/dev/null";
  if (system(command.c_str()) != 0) abort();
  std::filesystem::create_directories(root_ + "/etc/quorva/clients.d");
}

QRVDaemonProcess::~QRVDaemonProcess() {
  simulateReboot();
  std::error_code ec;
  std::filesystem::remove_all(root_, ec);
}

void QRVDaemonProcess::trustUID(uid_t uid, const std::string& signingIdentifier, const QRVPlist& entitlements) {
  QRVPlist entry = QRVPlist::dictionary()
                       .set("SigningIdentifier", QRVPlist::string(signingIdentifier))
                       .set("UID", QRVPlist::uinteger(uid))
                       .set("Entitlements", entitlements);
  trustEntry("uid-" + std::to_string(uid), entry);
}

void QRVDaemonProcess::trustEntry(const std::string& name, const QRVPlist& entry) {
  std::ofstream(root_ + "/etc/quorva/clients.d/" + name + ".plist") << entry.toXML();
}

QRVPlist QRVDaemonProcess::persona(uint64_t personaID, uint64_t type, const std::string& uniqueString,
                                   const std::string& home) {
  return QRVPlist::dictionary()
      .set("PersonaID", QRVPlist::uinteger(personaID))
      .set("UID", QRVPlist::uinteger(501))
      .set("GID", QRVPlist::uinteger(501))
      .set("Type", QRVPlist::uinteger(type))
      .set("UniqueString", QRVPlist::string(uniqueString))
      .set("Home", QRVPlist::string(home));
}

void QRVDaemonProcess::writePersonas(QRVPlist::Array personas) {
  const std::string path = root_ + "/etc/quorva/personas.plist";
  std::ofstream(path + ".new") << QRVPlist::array(std::move(personas)).toXML();
  if (std::rename((path + ".new").c_str(), path.c_str()) != 0) abort();
}

namespace {

bool answers(const std::string& socketPath) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  strncpy(addr.sun_path, socketPath.c_str(), sizeof addr.sun_path - 1);
  bool ok = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
  close(fd);
  return ok;
}

}  // namespace

std::chrono::milliseconds QRVDaemonProcess::start(const std::vector<std::string>& extraArguments) {
  auto begin = std::chrono::steady_clock::now();
  exitStatus_.reset();
  std::vector<std::string> args = {QUORVAD_BINARY, "--root", root_, "--log-level", "7"};
  args.insert(args.end(), extraArguments.begin(), extraArguments.end());
  pid_ = fork();
  if (pid_ == 0) {
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    // Leaks at exit are not what these tests look for.
    setenv("ASAN_OPTIONS", "detect_leaks=0", 0);
    execv(argv[0], argv.data());
    _exit(127);
  }
  // The socket is bound before start-up runs, but the first answer comes
  // only after it: wait for one, unless the daemon died on the way.
  for (int i = 0; i < 2000; i++) {
    int status = 0;
    if (waitpid(pid_, &status, WNOHANG) == pid_) {
      exitStatus_ = status;
      pid_ = -1;
      break;
    }
    if (answers(socketPath())) {
      QRVClientError error;
      auto client = QRVClient::connectToSocket(socketPath(), &error);
      if (client && client->sendRequest(QRVPlist::dictionary().set("Command", QRVPlist::uinteger(32)),
                                        std::chrono::seconds(10), &error))
        break;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - begin);
}

void QRVDaemonProcess::stop() {
  if (pid_ <= 0) return;
  kill(pid_, SIGTERM);
  if (!waitForExit(std::chrono::seconds(5))) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  pid_ = -1;
}

std::optional<int> QRVDaemonProcess::waitForExit(std::chrono::milliseconds timeout) {
  // Already reaped by start(); and with no daemon, waitpid(-1) would reap
  // some other child of the test.
  if (pid_ <= 0) return std::exchange(exitStatus_, std::nullopt);
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (std::chrono::steady_clock::now() < deadline) {
    int status = 0;
    if (waitpid(pid_, &status, WNOHANG) == pid_) {
      pid_ = -1;
      return status;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return std::nullopt;
}

void QRVDaemonProcess::simulateReboot() {
  stop();
  sem_unlink(("/" + QRVLinuxFirstBootMarker(root_).name()).c_str());
}

bool QRVDaemonProcess::bootWorkRecorded() const { return QRVLinuxFirstBootMarker(root_).exists(); }

bool QRVDaemonProcess::isRunning() {
  if (pid_ <= 0) return false;
  int status = 0;
  if (waitpid(pid_, &status, WNOHANG) == pid_) {
    pid_ = -1;
    return false;
  }
  return true;
}

std::string QRVDaemonProcess::readLog() const {
  std::ifstream in(logPath());
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

bool QRVDaemonProcess::logEventuallyContains(const std::string& text, std::chrono::milliseconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  do {
    if (readLog().find(text) != std::string::npos) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  } while (std::chrono::steady_clock::now() < deadline);
  return false;
}
