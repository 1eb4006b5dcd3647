// What the parts of quarterctl share: the global options, the subcommand
// table each group registers, argument parsing and the way a reply is shown.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "QuarterKit/QuarterKit.h"
#include "QuarterKit/Requests.h"
#include "base/PlistValue.h"
#include "base/QRTUUID.h"

namespace ctl {

constexpr int kExitOK = 0;
constexpr int kExitReplyError = 1;
constexpr int kExitUsage = 2;

struct UsageError {
  std::string message;
};

struct Global {
  std::string socketPath;
  bool json = false;
  std::chrono::milliseconds timeout = std::chrono::seconds(60);
  std::vector<std::string> args;  // the subcommand and its arguments
};

// The options of one subcommand as given, in order.
struct Args {
  std::vector<std::pair<std::string, std::string>> given;  // "--class", "2"; a switch has ""
  std::vector<std::string> words;                          // other words, where a subcommand takes them

  bool has(std::string_view flag) const;
  std::optional<std::string> value(std::string_view flag) const;  // the last one given
  std::vector<std::string> values(std::string_view flag) const;
};

struct Flag {
  const char* name;   // "--class"
  const char* value;  // what the value is ("N"); nullptr for a switch
};

inline const Flag kClassFlag{"--class", "N"}, kUserFlag{"--user", "N"}, kIdentifierFlag{"--identifier", "ID"},
    kUUIDFlag{"--uuid", "UUID"}, kTransientFlag{"--transient", nullptr};

struct Subcommand {
  const char* name;      // one word, or two ("info get")
  const char* commands;  // the daemon's command numbers it sends, for the help
  std::vector<Flag> flags;
  // Options that must be given; "--a|--b" is satisfied by either.
  std::vector<const char*> required;
  const char* help;
  int (*run)(const Global&, const Args&);
  bool words = false;  // takes words besides its options
};

// A group of subcommands, in the order the help lists them.
struct Group {
  int order;
  std::vector<Subcommand> subcommands;
};

// Each group file registers its table with a static Registration.
const std::vector<const Group*>& groups();
struct Registration {
  explicit Registration(const Group& group);
};

// getopt_long over args[first..]: onOption(val, optarg) for each option and,
// with words allowed, onOption(1, word) for each other word, all in order.
struct LongOption {
  const char* name;
  bool hasValue;
  int val;
};
void parseLong(const std::vector<std::string>& args, size_t first, const std::vector<LongOption>& longs,
               const std::string& context, bool words, const std::function<void(int, const char*)>& onOption);

// ---- values ---------------------------------------------------------------
uint64_t parseUnsigned(const std::string& text, const std::string& what);
int64_t parseSigned(const std::string& text, const std::string& what);
QRTUUID parseUUID(const std::string& text, const std::string& what);
plist::Value readPlistFile(const std::string& path);
plist::Value readDictionaryFile(const std::string& path);
// TYPE:VALUE, TYPE one of u64, i64, bool, str, uuid, data, plist.
plist::Value parseTyped(const std::string& type, const std::string& text, const std::string& key);
// KEY=TYPE:VALUE into the request.
void addAssignment(const std::string& arg, plist::Dictionary& request);

// ---- containers -------------------------------------------------------------
// The only user id the daemon accepts for bundle and system classes; for
// the others 1, which it reads as the current mobile user.
uint64_t ownerFor(uint64_t containerClass);
// The container named by --class, --user, --identifier and --uuid (or the
// options with the given prefix, "--old-").
qk::ContainerRef containerArgs(const Args& a, const std::string& prefix = "--");

// ---- sending and showing ---------------------------------------------------
// How a subcommand shows a reply when --json is not given.
enum class Output {
  Whole,  // every key, sorted
  Keys,   // only the listed keys the reply has
  List,   // "IDENTIFIER UUID" per container
  Value,  // the first listed key's value alone, on success
  Lines,  // the first listed key's array, one element a line, or dictionary, "KEY VALUE" a line
};

// Connects, sends, prints the reply and returns the exit status.
int deliver(const Global& global, const std::function<qk::Result(qk::Connection&)>& send,
            Output output = Output::Whole, const std::vector<std::string>& keys = {});

}  // namespace ctl
