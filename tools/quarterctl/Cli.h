// What the parts of quarterctl share: the global options, the subcommand
// table each group registers, argument parsing and the way a reply is shown.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include <nlohmann/json.hpp>

#include "QuarterKit/QuarterKit.h"
#include "QuarterKit/Requests.h"
#include "base/PlistValue.h"
#include "base/QRTProtocol.h"
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
  std::string deviceRoot;  // empty: the host's own daemon
  bool socketGiven = false;
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
  const char* help;
};

inline const Flag kClassFlag{"--class", "CLASS", "the content class, by name or number (see --help)"},
    kUserFlag{"--user", "N", "the user id (0 to 4294967294); defaults to the owner the class demands"},
    kIdentifierFlag{"--identifier", "ID", "the program or group identifier (1 to 255 bytes)"},
    kUUIDFlag{"--uuid", "UUID", "the container's internal UUID; looked up from the others when left out"},
    kTransientFlag{"--transient", nullptr, "the transient variant of the class"};

struct Subcommand {
  const char* name;      // one word, or two ("info get")
  const char* commands;  // the daemon's command numbers it sends, for the help
  std::vector<Flag> flags;
  // Options that must be given; "--a|--b" is satisfied by either.
  std::vector<const char*> required;
  const char* help;  // the first line is the summary
  int (*run)(const Global&, const Args&);
  const char* words = nullptr;  // the words it takes besides its options ("[KEY=TYPE:VALUE ...]")
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
uint64_t parseUser(const std::string& text, const std::string& what);
// A content class by name ("app-data") or number (1 to 13).
uint64_t parseClass(const std::string& text, const std::string& what);
// The class's name, or its number when it has none.
std::string className(uint64_t containerClass);
// The class names, "app-bundle (1), app-data (2), ...", for help texts.
std::string classList();
// An identifier as the daemon takes it: 1 to 255 bytes, no control character.
std::string checkIdentifier(const std::string& text, const std::string& what);
plist::Value readPlistFile(const std::string& path);
plist::Value readDictionaryFile(const std::string& path);
// TYPE:VALUE, TYPE one of u64, i64, bool, str, uuid, data, plist.
plist::Value parseTyped(const std::string& type, const std::string& text, const std::string& key);
// KEY=TYPE:VALUE into the request.
void addAssignment(const std::string& arg, plist::Dictionary& request);
// Refuses a message the daemon would drop unanswered.
void checkMessageSize(const plist::Value& message, const std::string& what);

// ---- containers -------------------------------------------------------------
// The only user id the daemon accepts for bundle and system classes; for
// the others 1, which it reads as the current mobile user.
uint64_t ownerFor(uint64_t containerClass);
// The container named by --class, --user, --identifier and --uuid (or the
// options with the given prefix, "--old-").
qk::ContainerRef containerArgs(const Args& a, const std::string& prefix = "--");

// ---- sending and showing ---------------------------------------------------
// Text for people: control characters and invalid UTF-8 escaped, so that
// what the daemon stores cannot forge a line or steer the terminal.
std::string printable(std::string_view text);
// A value in one line (UUIDs as text, nested values in the old-style form).
std::string plainText(const plist::Value& v);
nlohmann::json toJson(const plist::Value& v);
std::string sizeText(uint64_t bytes, bool units);

// Columns aligned under their headers; cells are made printable.
class Table {
 public:
  explicit Table(std::vector<std::string> headers) : rows_{std::move(headers)} {}
  void add(std::vector<std::string> cells) { rows_.push_back(std::move(cells)); }
  void print() const;

 private:
  std::vector<std::vector<std::string>> rows_;
};

// How a successful reply is shown. Without `human` it prints "ok"; without
// `json` it prints the reply's keys.
struct Show {
  using Hints = std::vector<std::pair<uint64_t, const char*>>;
  Show(std::function<void(const qk::Reply&)> human = {}, std::function<nlohmann::json(const qk::Reply&)> json = {},
       Hints hints = {})
      : human(std::move(human)), json(std::move(json)), hints(std::move(hints)) {}

  std::function<void(const qk::Reply&)> human;
  std::function<nlohmann::json(const qk::Reply&)> json;
  Hints hints;  // lines that explain an error code for this subcommand
};

using Send = std::function<qk::Result(qk::Connection&)>;

// Connects, sends, shows the reply and returns the exit status.
int deliver(const Global& global, const Send& send, const Show& show = {});
// Fills in the UUID (and identifier) of r by looking the container up when
// it was not given; the failed look-up's reply otherwise.
qk::Result resolve(qk::Connection& c, qk::ContainerRef& r);

}  // namespace ctl
