// quorvactl: send requests to quorvad from the command line.
//
// Every subcommand only turns its words into a request dictionary; sending,
// printing and the exit status are shared. A typed subcommand is one more
// row in kSubcommands and one function that builds its request.
#include <fmt/format.h>

#include <cstdio>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "QRVClient.h"
#include "QRVProtocol.h"
#include "QRVReplyFormat.h"
#include "QRVRequestArguments.h"

namespace {

// Scripts branch on these; keep them stable.
constexpr int kExitSuccess = 0;      // the daemon answered ReplyError = 1
constexpr int kExitDaemonError = 1;  // the daemon answered another code
constexpr int kExitUsage = 2;        // the command line is wrong
constexpr int kExitNoAnswer = 3;     // no usable reply from the daemon

constexpr std::chrono::milliseconds kDefaultTimeout(60'000);

struct Options {
  std::optional<std::string> root;
  bool json = false;
  std::chrono::milliseconds timeout = kDefaultTimeout;
};

// The command-line words still to be read.
class Words {
 public:
  Words(int argc, char** argv) : words_(argv + 1, argv + argc) {}
  bool empty() const { return next_ >= words_.size(); }
  std::string_view peek() const { return words_[next_]; }
  std::string take() { return words_[next_++]; }
  // Whether -h or --help comes before the end of the options ("--").
  bool helpRequested() const {
    for (size_t i = next_; i < words_.size() && words_[i] != "--"; i++)
      if (words_[i] == "-h" || words_[i] == "--help") return true;
    return false;
  }

 private:
  std::vector<std::string> words_;
  size_t next_ = 0;
};

// Reads the value of option `name` from "NAME VALUE" or "NAME=VALUE" at the
// front of `words`. Returns false when the front word is not that option;
// on a missing value sets `error`.
bool takeOptionValue(Words& words, std::string_view name, std::string* value, std::string* error) {
  std::string_view word = words.peek();
  if (word == name) {
    words.take();
    if (words.empty()) {
      *error = fmt::format("option {} needs a value", name);
      return true;
    }
    *value = words.take();
    return true;
  }
  if (word.size() > name.size() && word.substr(0, name.size()) == name &&
      word[name.size()] == '=') {
    *value = std::string(word.substr(name.size() + 1));
    words.take();
    return true;
  }
  return false;
}

// Consumes one of the options every subcommand accepts, if it is at the
// front. Returns false when the front word is not one of them.
bool takeCommonOption(Words& words, Options& options, std::string* error) {
  std::string value;
  if (words.peek() == "--json") {
    words.take();
    options.json = true;
    return true;
  }
  if (takeOptionValue(words, "--root", &value, error)) {
    if (error->empty()) {
      if (value.empty())
        *error = "--root needs a directory";
      else
        options.root = value;
    }
    return true;
  }
  if (takeOptionValue(words, "--timeout", &value, error)) {
    if (error->empty()) {
      auto ms = QRVRequestArguments::parseUnsigned(value);
      if (!ms || *ms > 365ull * 24 * 3600 * 1000)
        *error = fmt::format("--timeout needs a number of milliseconds, not \"{}\"", value);
      else
        options.timeout = *ms == 0 ? QRVClient::kNoTimeout : std::chrono::milliseconds(*ms);
    }
    return true;
  }
  return false;
}

bool isHelp(std::string_view word) { return word == "--help" || word == "-h"; }

// --- subcommands ----------------------------------------------------------

std::optional<QRVPlist> buildRaw(Words& words, Options& options, std::string* error) {
  std::optional<uint64_t> command;
  std::vector<std::string> arguments;
  bool optionsEnded = false;
  while (!words.empty()) {
    if (!optionsEnded && words.peek() == "--") {
      words.take();
      optionsEnded = true;
      continue;
    }
    std::string value;
    if (!optionsEnded && takeOptionValue(words, "--command", &value, error)) {
      if (!error->empty()) return std::nullopt;
      command = QRVRequestArguments::parseUnsigned(value);
      if (!command) command = QRVProtocol::commandForName(value);
      if (!command) {
        *error = fmt::format("--command needs a command number or name, not \"{}\"", value);
        return std::nullopt;
      }
      continue;
    }
    if (!optionsEnded && takeCommonOption(words, options, error)) {
      if (!error->empty()) return std::nullopt;
      continue;
    }
    if (!optionsEnded && words.peek().starts_with("--")) {
      *error = fmt::format("unknown option {}", words.peek());
      return std::nullopt;
    }
    arguments.push_back(words.take());
  }
  if (!command) {
    *error = "raw needs --command N";
    return std::nullopt;
  }
  return QRVRequestArguments::buildRequest(*command, arguments, error);
}

struct Subcommand {
  std::string_view name;
  std::string_view synopsis;
  std::string_view help;
  // Turns the words after the subcommand's name into a request. Returns
  // nothing with `error` set for a usage error. May change `options` (the
  // common options are accepted after the subcommand's name too).
  std::optional<QRVPlist> (*buildRequest)(Words& words, Options& options, std::string* error);
};

constexpr Subcommand kSubcommands[] = {
    {"raw", "raw --command N [KEY=VALUE ...]",
     R"(Sends command N with the given keys, and prints the reply. N is a command
number or name (see quorvactl --help); numbers outside 0 to 31 are sent as
given, for trying how the daemon refuses them.

Values:
  KEY=123              unsigned integer (decimal digits only)
  KEY=true, KEY=false  boolean
  KEY=text             string (anything else; "KEY=" is the empty string)
  KEY:uint=N           unsigned integer, decimal or 0x-prefixed hex
  KEY:bool=B           boolean: true/false, yes/no, 1/0
  KEY:str=S            string, literally (for example KEY:str=123)
  KEY:data=HEX         bytes, from an even number of hex digits
  KEY:uuid=UUID        UUID (16 bytes of data), 8-4-4-4-12 hex digits
  KEY:strs=a,b,c       array of strings (KEY:strs= is the empty array)
  KEY:uints=1,2        array of unsigned integers
  KEY:plist=@FILE      any value, from an XML or binary property-list file
  KEY:plist=XML        any value, from inline XML property-list text
Only the first '=' separates key and value. A key may be given once.
"--" ends the options, for keys that begin with "--".

Example:
  quorvactl raw --command 0 Identifier=com.example.app ContainerClass=2 \
      CreateIfNecessary=true
)",
     buildRaw},
};

const Subcommand* findSubcommand(std::string_view name) {
  for (const auto& subcommand : kSubcommands)
    if (subcommand.name == name) return &subcommand;
  return nullptr;
}

// --- help -----------------------------------------------------------------

void printMainHelp() {
  std::string commands;
  for (const auto& subcommand : kSubcommands)
    commands += fmt::format("  quorvactl [OPTIONS] {}\n", subcommand.synopsis);
  std::string names;
  for (uint64_t i = 0; i < QRVProtocol::kCommandCount; i++)
    names += fmt::format("  {:2}  {}\n", i, QRVProtocol::commandName(i));
  fmt::print(R"(Usage:
{}  quorvactl help SUBCOMMAND

Sends one request to quorvad and prints its reply.

Options (before or after the subcommand):
  --root DIR      root directory of the quorvad instance; the socket is
                  DIR/run/quorvad/com.kelva.quorvad. Default: $QUORVAD_ROOT
                  when set, else /.
  --json          print the reply as one JSON object (data as hex strings)
  --timeout MS    give up after MS milliseconds (default {}; 0 waits forever)
  -h, --help      show this help, or a subcommand's with SUBCOMMAND --help

Output: one "Key = value" line per reply key, such as
  ReplyError = 1 (success)
or, with --json, a JSON object with the same keys.

Exit status:
  0  the daemon answered ReplyError = 1 (success)
  1  the daemon answered another result code
  2  usage error
  3  no answer: quorvad is not running or unreachable, timed out, closed the
     connection or sent a malformed reply

Command numbers and names, for raw --command:
{})",
             commands, kDefaultTimeout.count(), names);
}

void printSubcommandHelp(const Subcommand& subcommand) {
  fmt::print(
      "Usage: quorvactl [OPTIONS] {}\n\n{}\nSee quorvactl --help for the OPTIONS and the exit "
      "status.\n",
      subcommand.synopsis, subcommand.help);
}

int usageError(std::string_view message) {
  fmt::print(stderr, "quorvactl: {}\nTry 'quorvactl --help'.\n", message);
  return kExitUsage;
}

// --- running --------------------------------------------------------------

int sendAndPrint(const Options& options, const QRVPlist& request) {
  QRVClientError error;
  std::string root = QRVClient::resolveRoot(options.root);
  auto client = QRVClient::connect(root, &error);
  if (!client) {
    fmt::print(stderr, "quorvactl: {}\n", error.message);
    return kExitNoAnswer;
  }
  auto reply = client->sendRequest(request, options.timeout, &error);
  if (!reply) {
    fmt::print(stderr, "quorvactl: {}\n", error.message);
    return kExitNoAnswer;
  }
  if (options.json)
    fmt::print("{}\n", QRVReplyFormat::json(*reply));
  else
    fmt::print("{}", QRVReplyFormat::human(*reply));
  return QRVClient::resultCode(*reply) == QRVProtocol::kResultSuccess ? kExitSuccess
                                                                      : kExitDaemonError;
}

}  // namespace

int main(int argc, char** argv) {
  Words words(argc, argv);
  Options options;
  std::string error;

  while (!words.empty() && words.peek().starts_with("-")) {
    if (isHelp(words.peek())) {
      printMainHelp();
      return kExitSuccess;
    }
    if (!takeCommonOption(words, options, &error))
      return usageError(fmt::format("unknown option {}", words.peek()));
    if (!error.empty()) return usageError(error);
  }
  if (words.empty()) return usageError("no subcommand given");

  std::string name = words.take();
  if (name == "help") {
    if (words.empty()) {
      printMainHelp();
      return kExitSuccess;
    }
    const Subcommand* subcommand = findSubcommand(words.peek());
    if (!subcommand) return usageError(fmt::format("unknown subcommand \"{}\"", words.peek()));
    printSubcommandHelp(*subcommand);
    return kExitSuccess;
  }
  const Subcommand* subcommand = findSubcommand(name);
  if (!subcommand) return usageError(fmt::format("unknown subcommand \"{}\"", name));
  if (words.helpRequested()) {
    printSubcommandHelp(*subcommand);
    return kExitSuccess;
  }

  auto request = subcommand->buildRequest(words, options, &error);
  if (!request) return usageError(error);
  return sendAndPrint(options, *request);
}
