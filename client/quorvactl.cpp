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

#include "base/QRVResultCode.h"
#include "client/QRVClient.h"
#include "client/QRVContainerClient.h"
#include "client/QRVProtocol.h"
#include "client/QRVReplyFormat.h"
#include "client/QRVRequestArguments.h"
#include "client/QRVUpcallClient.h"

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


// --- typed subcommands ----------------------------------------------------

// Everything the typed subcommands take. Each subcommand names the options
// it accepts, so a misplaced option is a usage error rather than ignored.
struct Typed {
  QRVContainerRef container;
  QRVContainerRef replacement;  // replace: the --new-* side
  bool haveId = false, haveClass = false, haveNewId = false, haveNewClass = false;
  bool create = false, transient = false, info = false, relative = false, thirdParty = false, retryIfLocked = false;
  std::optional<bool> enable;
  std::optional<std::string> key, path, dest, group;
  std::optional<QRVPlist> signing, signingOptions;
  std::optional<QRVPlist> value;
  std::optional<uint64_t> lock, crashes, protectionClass;
};

bool parseUUID(const std::string& text, QRVUUIDBytes* out, std::string* error) {
  // Also the 32 bare hex digits --json prints for a UUID, so one call's
  // output can feed the next.
  std::string why;
  auto parsed = QRVRequestArguments::parseArgument((text.size() == 32 ? "U:data=" : "U:uuid=") + text, &why);
  if (!parsed || parsed->second.dataValue().size() != 16) {
    *error = fmt::format("\"{}\" is not a UUID (8-4-4-4-12 hex digits)", text);
    return false;
  }
  const auto& bytes = parsed->second.dataValue();
  std::copy(bytes.begin(), bytes.end(), out->begin());
  return true;
}

bool parseNumber(std::string_view option, const std::string& text, uint64_t* out, std::string* error) {
  auto n = QRVRequestArguments::parseUnsigned(text);
  if (!n) *error = fmt::format("{} needs a number, not \"{}\"", option, text);
  else *out = *n;
  return n.has_value();
}

// Reads the subcommand's options. `allowed` is the space-separated list of
// the options it accepts besides the common ones.
bool parseTyped(Words& words, Options& options, std::string_view allowed, Typed* t, std::string* error) {
  auto accepts = [&](std::string_view name) {
    for (size_t at = allowed.find(name); at != std::string_view::npos; at = allowed.find(name, at + 1))
      if ((at == 0 || allowed[at - 1] == ' ') &&
          (at + name.size() == allowed.size() || allowed[at + name.size()] == ' '))
        return true;
    return false;
  };
  static constexpr std::string_view kFlags[] = {"--create",  "--transient",   "--info",           "--relative",
                                                "--enable",  "--disable",     "--third-party",    "--retry-if-locked"};
  static constexpr std::string_view kValued[] = {
      "--id",    "--class", "--persona", "--uuid", "--new-id",  "--new-class", "--new-persona", "--new-uuid", "--key",
      "--value", "--path",  "--dest",    "--lock", "--crashes", "--group",     "--signing",     "--options",
      "--protection-class"};
  while (!words.empty()) {
    if (takeCommonOption(words, options, error)) {
      if (!error->empty()) return false;
      continue;
    }
    std::string_view word = words.peek();
    bool matched = false;
    for (std::string_view flag : kFlags) {
      if (word != flag || !accepts(flag)) continue;
      words.take();
      matched = true;
      if (flag == "--create") t->create = true;
      if (flag == "--transient") t->transient = true;
      if (flag == "--info") t->info = true;
      if (flag == "--relative") t->relative = true;
      if (flag == "--enable") t->enable = true;
      if (flag == "--disable") t->enable = false;
      if (flag == "--third-party") t->thirdParty = true;
      if (flag == "--retry-if-locked") t->retryIfLocked = true;
      break;
    }
    if (matched) continue;
    for (std::string_view name : kValued) {
      std::string v;
      if (!accepts(name) || !takeOptionValue(words, name, &v, error)) continue;
      if (!error->empty()) return false;
      matched = true;
      bool good = true;
      uint64_t n = 0;
      if (name == "--id") t->container.identifier = v, t->haveId = true;
      if (name == "--new-id") t->replacement.identifier = v, t->haveNewId = true;
      if (name == "--persona") t->container.persona = v;
      if (name == "--new-persona") t->replacement.persona = v;
      if (name == "--class" && (good = parseNumber(name, v, &n, error))) t->container.containerClass = n, t->haveClass = true;
      if (name == "--new-class" && (good = parseNumber(name, v, &n, error)))
        t->replacement.containerClass = n, t->haveNewClass = true;
      if (name == "--uuid" && (good = parseUUID(v, &t->container.uuid.emplace(), error))) {}
      if (name == "--new-uuid" && (good = parseUUID(v, &t->replacement.uuid.emplace(), error))) {}
      if (name == "--key") t->key = v;
      if (name == "--path") t->path = v;
      if (name == "--dest") t->dest = v;
      if (name == "--group") t->group = v;
      if (name == "--signing" || name == "--options") {
        // A property list: "@FILE" or inline XML, as KEY:plist= words take.
        auto parsed = QRVRequestArguments::parseArgument("Value:plist=" + v, error);
        if ((good = parsed.has_value())) (name == "--signing" ? t->signing : t->signingOptions) = parsed->second;
      }
      if (name == "--lock" && (good = parseNumber(name, v, &n, error))) t->lock = n;
      if (name == "--crashes" && (good = parseNumber(name, v, &n, error))) t->crashes = n;
      if (name == "--protection-class" && (good = parseNumber(name, v, &n, error))) t->protectionClass = n;
      if (name == "--value") {
        // "--value TEXT" guesses the type as KEY=VALUE words do; a value
        // starting with ':' spells it out ("--value :uint=5").
        auto parsed = QRVRequestArguments::parseArgument(v.starts_with(":") ? "Value" + v : "Value=" + v, error);
        if ((good = parsed.has_value())) t->value = parsed->second;
      }
      if (!good) return false;
      break;
    }
    if (matched) continue;
    *error = word.starts_with("-") ? fmt::format("unknown option {}", word)
                                   : fmt::format("unexpected argument \"{}\"", word);
    return false;
  }
  return true;
}

bool require(bool present, std::string_view what, std::string* error) {
  if (!present) *error = fmt::format("{} is required", what);
  return present;
}

namespace R = QRVContainerRequests;

// One typed subcommand: its accepted options and how they become a request.
#define QRV_TYPED(function, allowed, body)                                                    \
  std::optional<QRVPlist> function(Words& words, Options& options, std::string* error) {      \
    Typed t;                                                                                  \
    if (!parseTyped(words, options, allowed, &t, error)) return std::nullopt;                 \
    body                                                                                      \
  }

QRV_TYPED(buildLookup, "--id --class --persona --create --transient", {
  if (!require(t.haveId, "--id", error) || !require(t.haveClass, "--class", error)) return std::nullopt;
  return R::createOrLookupContainer(t.container, t.create, t.transient);
})
QRV_TYPED(buildList, "--class --transient", {
  if (!require(t.haveClass, "--class", error)) return std::nullopt;
  return R::containersWithClass(t.container.containerClass, t.transient);
})
QRV_TYPED(buildReplace, "--id --class --persona --uuid --new-id --new-class --new-persona --new-uuid", {
  if (!require(t.haveId && t.haveClass, "--id and --class", error) ||
      !require(t.haveNewId && t.haveNewClass, "--new-id and --new-class", error))
    return std::nullopt;
  return R::replaceContainer(t.container, t.replacement);
})
QRV_TYPED(buildMetadata, "--id --class --persona --uuid --info", {
  if (!require(t.haveId && t.haveClass && t.container.uuid, "--id, --class and --uuid", error)) return std::nullopt;
  return R::containerMetadata(t.container, t.info);
})
QRV_TYPED(buildInfoGet, "--id --class --persona --uuid --key", {
  if (!require(t.haveId && t.haveClass && t.container.uuid && t.key, "--id, --class, --uuid and --key", error))
    return std::nullopt;
  return R::infoValueForKey(t.container, *t.key);
})
QRV_TYPED(buildInfoSet, "--id --class --persona --uuid --key --value", {
  if (!require(t.haveId && t.haveClass && t.container.uuid && t.key && t.value,
               "--id, --class, --uuid, --key and --value", error))
    return std::nullopt;
  return R::setInfoValue(t.container, *t.key, *t.value);
})
QRV_TYPED(buildDelete, "--id --class --persona --transient", {
  if (!require(t.haveId && t.haveClass, "--id and --class", error)) return std::nullopt;
  return R::deleteContainer(t.container, t.transient);
})
QRV_TYPED(buildWipe, "--id --persona", {
  if (!require(t.haveId, "--id", error)) return std::nullopt;
  return R::wipeContainerContent(t.container);
})
QRV_TYPED(buildDiskUsage, "--id --class --persona --uuid", {
  if (!require(t.haveId && t.haveClass && t.container.uuid, "--id, --class and --uuid", error)) return std::nullopt;
  return R::diskUsage(t.container);
})
QRV_TYPED(buildSetDataProtection, "--id --class --persona --protection-class --third-party --retry-if-locked", {
  if (!require(t.haveId && t.haveClass && t.protectionClass, "--id, --class and --protection-class", error))
    return std::nullopt;
  return R::setDataProtection(t.container, *t.protectionClass, t.thirdParty, t.retryIfLocked);
})
QRV_TYPED(buildAssetsPath, "--id --persona --relative --create", {
  if (!require(t.haveId, "--id", error)) return std::nullopt;
  return R::userManagedAssetsPath(t.container.identifier, t.container.persona, t.relative, t.create);
})
QRV_TYPED(buildAssetsDelete, "--id --persona --path", {
  if (!require(t.haveId && t.path, "--id and --path", error)) return std::nullopt;
  return R::deleteUserManagedAsset(t.container.identifier, t.container.persona, *t.path);
})
QRV_TYPED(buildStageDelete, "--id --class --persona --uuid", {
  if (!require(t.haveId && t.haveClass && t.container.uuid, "--id, --class and --uuid", error)) return std::nullopt;
  return R::stageContainersForDelete(
      {{t.container.identifier, t.container.containerClass, *t.container.uuid, t.container.persona.value_or("")}});
})
QRV_TYPED(buildRecreate, "--id --class --persona --uuid", {
  if (!require(t.haveId && t.haveClass && t.container.uuid, "--id, --class and --uuid", error)) return std::nullopt;
  return R::recreateDefaultStructure(t.container);
})
QRV_TYPED(buildRegenerateUUID, "--id --class --persona --uuid", {
  if (!require(t.haveId && t.haveClass && t.container.uuid, "--id, --class and --uuid", error)) return std::nullopt;
  return R::regenerateDirectoryUUID(t.container);
})
QRV_TYPED(buildDeleteContent, "--id --class --persona", {
  if (!require(t.haveId && t.haveClass, "--id and --class", error)) return std::nullopt;
  return R::deleteContainerContent(t.container);
})
QRV_TYPED(buildStageShared, "--id --path --dest", {
  if (!require(t.haveId && t.path && t.dest, "--id, --path and --dest", error)) return std::nullopt;
  return R::stageSharedContent(t.container.identifier, *t.path, *t.dest);
})
QRV_TYPED(buildRetryTest, "--crashes", { return R::retryTest(t.crashes.value_or(0)); })
QRV_TYPED(buildEmptyDeathRow, "", { return R::deleteContainersOnDeathRow(); })
QRV_TYPED(buildSetTestLock, "--lock --enable --disable", {
  if (!require(t.lock && t.enable, "--lock and --enable or --disable", error)) return std::nullopt;
  return R::setTestLock(*t.lock, *t.enable);
})

QRVGroupOwnerRef groupOwner(const Typed& t) {
  return {.owner = t.haveId ? std::optional<std::string>(t.container.identifier) : std::nullopt,
          .groupClass = t.container.containerClass,
          .persona = t.container.persona};
}
QRV_TYPED(buildGroupLookup, "--id --class --persona", {
  if (!require(t.haveClass, "--class", error)) return std::nullopt;
  return R::createOrLookupGroupContainers(groupOwner(t));
})
QRV_TYPED(buildGroupPaths, "--id --class --persona", {
  if (!require(t.haveClass, "--class", error)) return std::nullopt;
  return R::groupContainersForOwner(groupOwner(t));
})
QRV_TYPED(buildGroupIds, "--id --class", {
  if (!require(t.haveClass, "--class", error)) return std::nullopt;
  return R::groupContainerIdentifiersForOwner(groupOwner(t));
})
QRV_TYPED(buildSystemLookup, "--id", {
  if (!require(t.haveId, "--id", error)) return std::nullopt;
  return R::lookupSystemContainer(t.container.identifier);
})
QRV_TYPED(buildSystemGroupPath, "--group", {
  if (!require(t.group.has_value(), "--group", error)) return std::nullopt;
  return R::systemGroupContainerPath(*t.group);
})
QRV_TYPED(buildCodeSigningSet, "--id --signing --options", {
  if (!require(t.haveId, "--id", error)) return std::nullopt;
  return R::processCodeSigningInfo(t.container.identifier, t.signing, t.signingOptions);
})
QRV_TYPED(buildCodeSigningGet, "--id", {
  if (!require(t.haveId, "--id", error)) return std::nullopt;
  return R::codeSigningInfoForIdentifier(t.container.identifier);
})
QRV_TYPED(buildCodeSigningInvalidateOrphans, "",
          { return R::invalidateCodeSigningInfoForAppsWithoutBundleContainer(); })
QRV_TYPED(buildDataMigration, "", { return R::performDataMigration(); })
QRV_TYPED(buildPerUserMigration, "", { return R::performPerUserDataMigration(); })

#undef QRV_TYPED

// --- upcall ---------------------------------------------------------------

// Reads the upcall's options into `process`.
bool parseUpcall(Words& words, Options& options, QRVUpcallProcess* process, std::string* error) {
  auto number = [&](std::string_view name, const std::string& text, std::optional<uint32_t>* out) {
    uint64_t n = 0;
    if (!parseNumber(name, text, &n, error)) return false;
    if (n > UINT32_MAX) {
      *error = fmt::format("{} needs a 32-bit number, not \"{}\"", name, text);
      return false;
    }
    *out = static_cast<uint32_t>(n);
    return true;
  };
  static constexpr std::string_view kOptions[] = {
      "--code-signing-id", "--container-id", "--application-id", "--system-container", "--app-group",
      "--system-group",    "--uid",          "--persona",        "--container-type"};
  while (!words.empty()) {
    if (takeCommonOption(words, options, error)) {
      if (!error->empty()) return false;
      continue;
    }
    std::string word(words.peek());
    std::string_view name;
    std::string v;
    for (std::string_view o : kOptions)
      if (takeOptionValue(words, o, &v, error)) {
        name = o;
        break;
      }
    if (!error->empty()) return false;
    if (name.empty()) {
      *error = fmt::format("upcall does not take \"{}\"", word);
      return false;
    }
    if (name == "--code-signing-id") process->codeSigningIdentifier = v;
    if (name == "--container-id") process->containerIdentifier = v;
    if (name == "--application-id") process->applicationIdentifier = v;
    if (name == "--system-container") process->systemContainerIdentifier = v;
    if (name == "--app-group") process->appGroupIdentifiers.push_back(v);
    if (name == "--system-group") process->systemGroupIdentifiers.push_back(v);
    if ((name == "--uid" && !number(name, v, &process->uid)) ||
        (name == "--persona" && !number(name, v, &process->personaID)) ||
        (name == "--container-type" && !number(name, v, &process->containerType)))
      return false;
  }
  return true;
}

int runUpcall(Words& words, Options& options) {
  QRVUpcallProcess process;
  std::string error;
  if (!parseUpcall(words, options, &process, &error)) {
    fmt::print(stderr, "quorvactl: {}\nTry 'quorvactl help upcall'.\n", error);
    return kExitUsage;
  }
  QRVClientError clientError;
  auto answer = QRVUpcallClient::ask(QRVClient::resolveRoot(options.root), process, options.timeout, &clientError);
  if (!answer) {
    fmt::print(stderr, "quorvactl: {}\n", clientError.message);
    return kExitNoAnswer;
  }
  if (answer->returnCode != 0) {
    // Return codes may be negative, which the reply renderings (unsigned
    // numbers only) cannot show.
    const char* meaning = QRVUpcallClient::returnCodeMeaning(answer->returnCode);
    if (options.json)
      fmt::print("{{\"ReturnCode\": {}, \"Meaning\": {}}}\n", answer->returnCode, QRVReplyFormat::jsonString(meaning));
    else
      fmt::print("ReturnCode = {} ({})\n", answer->returnCode, meaning);
    return kExitDaemonError;
  }
  QRVPlist reply = answer->containers.plist();
  reply.set("ReturnCode", QRVPlist::uinteger(0));
  if (options.json)
    fmt::print("{}\n", QRVReplyFormat::json(reply));
  else
    fmt::print("{}", QRVReplyFormat::human(reply));
  return kExitSuccess;
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
    {"lookup", "lookup --id ID --class N [--persona S] [--create] [--transient]",
     "Looks up the container of ID in class N, creating it with --create.\nPrints its path, UUID and whether it "
     "existed.\n",
     buildLookup},
    {"list", "list --class N [--transient]", "Lists the containers of class N (identifiers, UUIDs, personas).\n",
     buildList},
    {"metadata", "metadata --id ID --class N --uuid UUID [--persona S] [--info]",
     "UUID is 8-4-4-4-12 hex digits or the 32 digits --json prints.\nPrints a container's path and whether it is "
     "transient; --info adds its info dictionary.\n",
     buildMetadata},
    {"info-get", "info-get --id ID --class N --uuid UUID --key K [--persona S]",
     "Prints the value stored under K in a container's info.\n", buildInfoGet},
    {"info-set", "info-set --id ID --class N --uuid UUID --key K --value V [--persona S]",
     "Stores V under K in a container's info. V is typed as KEY=VALUE words are\n(see raw --help); "
     "\":TYPE=V\" spells the type out, for example --value :uint=5.\n",
     buildInfoSet},
    {"delete", "delete --id ID --class N [--persona S] [--transient]", "Deletes the container of ID in class N.\n",
     buildDelete},
    {"wipe", "wipe --id ID [--persona S]", "Deletes the content of ID's plug-in data container.\n", buildWipe},
    {"replace",
     "replace --id ID --class N [--uuid U] --new-id ID --new-class N [--new-uuid U] [--persona S] [--new-persona S]",
     "Replaces a container with another one.\n", buildReplace},
    {"disk-usage", "disk-usage --id ID --class N --uuid UUID [--persona S]", "Prints the bytes a container uses.\n",
     buildDiskUsage},
    {"set-data-protection",
     "set-data-protection --id ID --class N --protection-class P [--persona S] [--third-party] [--retry-if-locked]",
     "Changes the protection class of a data container's files to P. With\n--retry-if-locked, a locked device "
     "makes the daemon wait for the next unlock\n(the answer comes then); without it the answer is 61.\n",
     buildSetDataProtection},
    {"assets-path", "assets-path --id ID [--persona S] [--relative] [--create]",
     "Prints the user-managed assets directory of ID's application data container.\n", buildAssetsPath},
    {"assets-delete", "assets-delete --id ID --path P [--persona S]", "Deletes the user-managed asset P of ID.\n",
     buildAssetsDelete},
    {"stage-delete", "stage-delete --id ID --class N --uuid UUID [--persona S]",
     "Stages a container for deletion (see empty-death-row).\n", buildStageDelete},
    {"recreate", "recreate --id ID --class N --uuid UUID [--persona S]",
     "Recreates a container's default directory structure.\n", buildRecreate},
    {"regenerate-uuid", "regenerate-uuid --id ID --class N --uuid UUID [--persona S]",
     "Gives a container's directory a new UUID.\n", buildRegenerateUUID},
    {"delete-content", "delete-content --id ID --class N [--persona S]",
     "Deletes the content of a data container, keeping the container.\n", buildDeleteContent},
    {"stage-shared", "stage-shared --id ID --path SOURCE --dest DEST",
     "Stages SOURCE as shared content of ID under DEST; prints where it went.\n", buildStageShared},
    {"retry-test", "retry-test [--crashes N]", "Runs the retry test with N crashes (internal builds only).\n",
     buildRetryTest},
    {"empty-death-row", "empty-death-row", "Deletes the containers staged for deletion; answers when that is done.\n",
     buildEmptyDeathRow},
    {"set-test-lock", "set-test-lock --lock N (--enable | --disable)",
     "Holds or releases test lock N (internal builds only).\n", buildSetTestLock},
    {"group-lookup", "group-lookup --class N [--id OWNER] [--persona S]",
     "Creates or looks up the group containers OWNER claims (default: the caller\n"
     "itself); N is 7 for application groups, 13 for system groups. Prints each\n"
     "group's path and sandbox token.\n",
     buildGroupLookup},
    {"group-paths", "group-paths --class N [--id OWNER] [--persona S]", "As group-lookup, without sandbox tokens.\n",
     buildGroupPaths},
    {"group-ids", "group-ids --class N [--id OWNER]",
     "Prints the group identifiers OWNER claims (default: the caller itself).\n", buildGroupIds},
    {"system-lookup", "system-lookup --id ID",
     "Prints the path of ID's system container; a well-known one is created if\nnecessary.\n", buildSystemLookup},
    {"system-group-path", "system-group-path --group G",
     "Prints the path of the system group container G, which the caller's code\nsigning must list.\n",
     buildSystemGroupPath},
    {"codesign-set", "codesign-set --id ID [--signing PLIST] [--options PLIST]",
     "Hands over ID's code-signing information as the installer does; without\n"
     "--signing, ID's information is removed. PLIST is @FILE or inline XML.\n",
     buildCodeSigningSet},
    {"codesign-get", "codesign-get --id ID", "Prints ID's stored code-signing information.\n", buildCodeSigningGet},
    {"codesign-invalidate-orphans", "codesign-invalidate-orphans",
     "Invalidates the code-signing information of applications whose bundle\ncontainer is gone.\n",
     buildCodeSigningInvalidateOrphans},
    {"data-migration", "data-migration",
     "Runs the data migrator's one-time migrations: ACLs of system containers,\n"
     "ownership of the bundle tree, code-signing data; then reconciles group and\n"
     "system containers with the installed applications.\n",
     buildDataMigration},
    {"per-user-migration", "per-user-migration",
     "Runs the per-user migrations: the default subdirectories of every user's\n"
     "containers (once), and the protection class of data containers that have\n"
     "no application.\n",
     buildPerUserMigration},
    {"upcall",
     "upcall [--code-signing-id ID] [--container-id ID] [--application-id ID] [--uid N] [--persona N] "
     "[--container-type N] [--app-group G ...] [--system-container ID] [--system-group G ...]",
     R"(Asks for every container path of a process, as a sandbox launcher does
before starting it, over DIR/run/quorvad/com.kelva.quorvad.upcall (root or
the entitlement com.kelva.private.Quorva.kernelUpcall only). The data
container is the one of --container-id, else of --code-signing-id;
--container-type is 0 for an application (default), 1 for a plug-in;
--persona is the kernel persona id (default: none). --app-group and
--system-group may be given several times.

Prints HomeDirectory, DataContainer, TempDirectory, AppGroups,
SystemContainer, SystemGroups (what was found), Complete (every lookup
succeeded) and ReturnCode = 0; a refused request prints only its
ReturnCode (55 not entitled, 4 bad request, 5 unreadable item, -300
malformed message) and exits with 1.
)",
     nullptr},
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
  return QRVClient::resultCode(*reply) == QRVResultCode::kSuccess ? kExitSuccess : kExitDaemonError;
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

  if (!subcommand->buildRequest) return runUpcall(words, options);
  auto request = subcommand->buildRequest(words, options, &error);
  if (!request) return usageError(error);
  return sendAndPrint(options, *request);
}
