// quarterctl: sends requests to quarterd and prints the replies, for people
// and for scripts (--json). Exit status: 0 success, 1 the daemon answered
// with an error, 2 usage or connection trouble.
#include <getopt.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <functional>
#include <iostream>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include <nlohmann/json.hpp>

#include "QuarterKit/Errors.h"
#include "QuarterKit/QuarterKit.h"
#include "QuarterKit/Requests.h"
#include "base/PlistCodec.h"
#include "base/QRTUUID.h"

namespace {

constexpr int kExitOK = 0;
constexpr int kExitReplyError = 1;
constexpr int kExitUsage = 2;
constexpr size_t kMaxPlistFile = 64u * 1024 * 1024;

const char kUsageHead[] = R"(usage: quarterctl [--root DIR | --socket PATH] [--json] [--timeout SECONDS] COMMAND ...

Sends one request to quarterd and prints its reply.

Options:
  --root DIR         talk to the daemon of device root DIR (socket DIR/run/com.norvane.quarterd);
                     without --root and --socket, the root comes from QUARTERD_ROOT, else
                     this machine's daemon answers (socket /run/quarterd/request.sock)
  --socket PATH      talk to the request socket at PATH
  --json             print the whole reply as a JSON object: integers as numbers, 16-byte data
                     as UUID strings, other data as base64 strings, dates as ISO 8601 strings
  --timeout SECONDS  how long to wait for the reply (default 60)
  -h, --help         this text
  -V, --version      the version

Commands:
  raw [--file FILE] [KEY=TYPE:VALUE ...]
      Sends any request. FILE is a property list (binary or XML) whose top-level dictionary
      is the request; KEY=TYPE:VALUE pairs are added to it (and replace its keys). TYPE is
        u64     unsigned integer, decimal or 0x-hex
        i64     signed integer, decimal or 0x-hex
        bool    true or false
        str     a string, taken as is
        uuid    a UUID in text form, sent as 16-byte data
        data    hex bytes, sent as data
        plist   path of a property-list file, whose value is sent
      Without a "Command" key the daemon takes command 0. Example:
        quarterctl raw Command=u64:1 UserID=u64:501 ContainerClass=u64:2
)";

const char kUsageTail[] = R"(
--user defaults to the owner the class demands: 33 for the bundle classes 1, 3, 5 and 8,
499 for classes 12 and 13, otherwise 1 (the current mobile user). --uuid is the container's
internal UUID, as create and lookup print it. create, lookup and system-path take the
caller's own identifier when --identifier is missing.

Output: create, lookup, system-path and metadata print "Key: value" lines for the reply keys
they are about; list prints "IDENTIFIER UUID" per container; info get, du, system-group-path
and codesign get print the value alone; groups prints one line per group; the others, and raw,
print every other reply key, sorted, then "ok". 16-byte data is shown as a UUID and nested
values in the old-style property-list text form. A failure is reported on standard error
with its code and what it means: quarterctl: error 21 (no such container).

Exit status: 0 when the reply's ReplyError is 1, 1 when it is another value, 2 on usage
errors, connection failures and when no reply came.
)";

struct Options {
  std::string socketPath = qk::requestSocketPath("/");
  bool json = false;
  bool help = false;
  bool version = false;
  std::chrono::milliseconds timeout = std::chrono::seconds(60);
  std::vector<std::string> args;  // the command and its arguments
};

struct UsageError {
  std::string message;
};

// getopt_long over args[first..]: onOption(val, optarg) for each option and,
// with words allowed, onOption(1, word) for each other word, all in order.
void parseLong(const std::vector<std::string>& args, size_t first, const std::vector<option>& longs,
               const std::string& context, bool words, const std::function<void(int, const char*)>& onOption) {
  std::vector<std::string> storage{context};
  storage.insert(storage.end(), args.begin() + static_cast<std::ptrdiff_t>(first), args.end());
  std::vector<char*> argv;
  for (std::string& a : storage) argv.push_back(a.data());
  argv.push_back(nullptr);
  std::vector<option> table = longs;
  table.push_back({nullptr, 0, nullptr, 0});
  const int argc = static_cast<int>(storage.size());
  optind = 0;  // a full restart: this runs once per word list
  opterr = 0;
  for (int c; (c = getopt_long(argc, argv.data(), "-:", table.data(), nullptr)) != -1;) {
    if (c == ':') throw UsageError{std::string(argv[optind - 1]) + " needs a value"};
    if (c == '?' || (c == 1 && !words))
      throw UsageError{"unknown argument to " + context + ": " + (c == 1 ? optarg : argv[optind - 1])};
    onOption(c, optarg);
  }
}

// ---- parsing ----------------------------------------------------------------

uint64_t parseUnsigned(const std::string& text, const std::string& what) {
  if (text.empty() || text[0] == '-' || text[0] == '+' || isspace(static_cast<unsigned char>(text[0])))
    throw UsageError{"not an unsigned number for " + what + ": " + text};
  errno = 0;
  char* end = nullptr;
  unsigned long long v = strtoull(text.c_str(), &end, 0);
  if (errno != 0 || *end != '\0') throw UsageError{"not an unsigned number for " + what + ": " + text};
  return v;
}

int64_t parseSigned(const std::string& text, const std::string& what) {
  if (text.empty() || isspace(static_cast<unsigned char>(text[0])))
    throw UsageError{"not a number for " + what + ": " + text};
  errno = 0;
  char* end = nullptr;
  long long v = strtoll(text.c_str(), &end, 0);
  if (errno != 0 || *end != '\0') throw UsageError{"not a number for " + what + ": " + text};
  return v;
}

plist::Data parseHex(const std::string& text, const std::string& what) {
  auto nibble = [](char c) -> int {
    if (c >= '0' && c <= '9') return c - '0';
    if (c >= 'a' && c <= 'f') return c - 'a' + 10;
    if (c >= 'A' && c <= 'F') return c - 'A' + 10;
    return -1;
  };
  if (text.size() % 2 != 0) throw UsageError{"odd number of hex digits for " + what};
  plist::Data out;
  for (size_t i = 0; i < text.size(); i += 2) {
    int hi = nibble(text[i]), lo = nibble(text[i + 1]);
    if (hi < 0 || lo < 0) throw UsageError{"not hex for " + what + ": " + text};
    out.push_back(static_cast<uint8_t>(hi << 4 | lo));
  }
  return out;
}

plist::Value readPlistFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) throw UsageError{"cannot read " + path + ": " + strerror(errno)};
  std::string bytes;
  char chunk[65536];
  while (in.read(chunk, sizeof chunk) || in.gcount() > 0) {
    bytes.append(chunk, static_cast<size_t>(in.gcount()));
    if (bytes.size() > kMaxPlistFile) throw UsageError{path + " is too large"};
  }
  std::string error;
  auto value = plist::parse(bytes.data(), bytes.size(), &error);
  if (!value) throw UsageError{path + " is not a property list: " + error};
  return std::move(*value);
}

plist::Value parseTyped(const std::string& type, const std::string& text, const std::string& key) {
  if (type == "u64") {
    uint64_t v = parseUnsigned(text, key);
    return plist::Value(plist::Integer{v, v > static_cast<uint64_t>(INT64_MAX)});
  }
  if (type == "i64") return plist::Value(plist::Integer{static_cast<uint64_t>(parseSigned(text, key)), false});
  if (type == "bool") {
    if (text == "true") return plist::Value(true);
    if (text == "false") return plist::Value(false);
    throw UsageError{"bool must be true or false for " + key + ": " + text};
  }
  if (type == "str") return plist::Value(text);
  if (type == "uuid") {
    auto uuid = QRTUUID::fromString(text);
    if (!uuid) throw UsageError{"not a UUID for " + key + ": " + text};
    return qk::uuidValue(*uuid);
  }
  if (type == "data") return plist::Value(parseHex(text, key));
  if (type == "plist") return readPlistFile(text);
  throw UsageError{"unknown type '" + type + "' for " + key + " (u64, i64, bool, str, uuid, data, plist)"};
}

// KEY=TYPE:VALUE into the request.
void addAssignment(const std::string& arg, plist::Dictionary& request) {
  size_t eq = arg.find('=');
  size_t colon = eq == std::string::npos ? std::string::npos : arg.find(':', eq + 1);
  if (eq == std::string::npos || eq == 0 || colon == std::string::npos)
    throw UsageError{"expected KEY=TYPE:VALUE, got: " + arg};
  std::string key = arg.substr(0, eq);
  request.insert_or_assign(key, parseTyped(arg.substr(eq + 1, colon - eq - 1), arg.substr(colon + 1), key));
}

// ---- printing ---------------------------------------------------------------

std::optional<std::string> uuidText(const plist::Value& v) {
  const plist::Data* d = v.dataIf();
  if (!d || d->size() != 16) return std::nullopt;
  auto uuid = QRTUUID::fromBytes(d->data(), d->size());
  return uuid ? std::optional<std::string>(uuid->UUIDString()) : std::nullopt;
}

// 16-byte data becomes its UUID string, so nested listings stay readable.
plist::Value withUUIDStrings(const plist::Value& v) {
  if (auto uuid = uuidText(v)) return plist::Value(*uuid);
  if (const plist::Array* a = v.arrayIf()) {
    plist::Array out;
    for (const plist::Value& e : *a) out.push_back(withUUIDStrings(e));
    return plist::Value(std::move(out));
  }
  if (const plist::Dictionary* d = v.dictionaryIf()) {
    plist::Dictionary out;
    for (const auto& [k, e] : *d) out.emplace(k, withUUIDStrings(e));
    return plist::Value(std::move(out));
  }
  return v;
}

std::string integerText(const plist::Integer& i) {
  return i.isUnsigned ? std::to_string(i.asUnsigned()) : std::to_string(i.asSigned());
}

std::string realText(double d) {
  char buf[64];
  snprintf(buf, sizeof buf, "%.17g", d);
  return buf;
}

// ISO 8601 in UTC; dates beyond what the calendar functions handle keep
// their raw seconds.
std::string dateText(const plist::Date& date) {
  constexpr double kEpochOffset = 978307200.0;  // 1970-01-01 to 2001-01-01
  double unixSeconds = date.seconds + kEpochOffset;
  if (!std::isfinite(unixSeconds) || std::fabs(unixSeconds) > 1e13) return realText(date.seconds);
  double whole = std::floor(unixSeconds);
  time_t t = static_cast<time_t>(whole);
  struct tm tm {};
  if (!gmtime_r(&t, &tm)) return realText(date.seconds);
  char buf[96];
  size_t n = strftime(buf, sizeof buf, "%Y-%m-%dT%H:%M:%S", &tm);
  long millis = static_cast<long>((unixSeconds - whole) * 1000);
  if (millis > 0) n += static_cast<size_t>(snprintf(buf + n, sizeof buf - n, ".%03ld", millis));
  return std::string(buf, n) + "Z";
}

std::string hexText(const plist::Data& d) {
  static const char digits[] = "0123456789abcdef";
  std::string out = "<";
  for (uint8_t b : d) {
    out += digits[b >> 4];
    out += digits[b & 15];
  }
  return out + ">";
}

std::string plainText(const plist::Value& v) {
  switch (v.type()) {
    case plist::Type::Boolean: return v.boolean() ? "true" : "false";
    case plist::Type::Integer: return integerText(v.integer());
    case plist::Type::Real: return realText(v.real());
    case plist::Type::Date: return dateText(v.date());
    case plist::Type::String: return v.string();
    case plist::Type::Data: return uuidText(v).value_or(hexText(v.data()));
    case plist::Type::Array:
    case plist::Type::Dictionary: return plist::describe(withUUIDStrings(v));
  }
  return "";
}

std::string base64(const plist::Data& d) {
  static const char alphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string out;
  for (size_t i = 0; i < d.size(); i += 3) {
    uint32_t chunk = static_cast<uint32_t>(d[i]) << 16;
    if (i + 1 < d.size()) chunk |= static_cast<uint32_t>(d[i + 1]) << 8;
    if (i + 2 < d.size()) chunk |= d[i + 2];
    out += alphabet[chunk >> 18 & 63];
    out += alphabet[chunk >> 12 & 63];
    out += i + 1 < d.size() ? alphabet[chunk >> 6 & 63] : '=';
    out += i + 2 < d.size() ? alphabet[chunk & 63] : '=';
  }
  return out;
}

nlohmann::json toJson(const plist::Value& v) {
  switch (v.type()) {
    case plist::Type::Boolean: return v.boolean();
    case plist::Type::Integer:
      if (v.integer().isUnsigned) return v.integer().asUnsigned();
      return v.integer().asSigned();
    case plist::Type::Real: return v.real();  // NaN and infinities dump as null
    case plist::Type::Date: return dateText(v.date());
    case plist::Type::String: return v.string();
    case plist::Type::Data: return uuidText(v).value_or(base64(v.data()));
    case plist::Type::Array: {
      nlohmann::json out = nlohmann::json::array();
      for (const plist::Value& e : v.array()) out.push_back(toJson(e));
      return out;
    }
    case plist::Type::Dictionary: {
      nlohmann::json out = nlohmann::json::object();
      for (const auto& [k, e] : v.dictionary()) out[k] = toJson(e);
      return out;
    }
  }
  return nullptr;
}

// How a subcommand shows a reply when --json is not given.
enum class Output {
  Whole,  // every key, sorted
  Keys,   // only the listed keys the reply has
  List,   // "IDENTIFIER UUID" per container
  Value,  // the first listed key's value alone, on success
  Lines,  // the first listed key's array, one element a line, or dictionary, "KEY VALUE" a line
};

void printList(const qk::Reply& reply) {
  const plist::Array* ids = reply.array("ReplyIdsArray");
  const plist::Array* uuids = reply.array("ReplyUUIDsArray");
  if (!ids || !uuids) return;
  for (size_t i = 0; i < std::min(ids->size(), uuids->size()); ++i)
    std::cout << plainText((*ids)[i]) << ' ' << plainText((*uuids)[i]) << '\n';
}

void printReply(const qk::Reply& reply, const Options& options, Output output,
                const std::vector<std::string>& keys) {
  if (options.json) {
    // A string the daemon sent that is not UTF-8 is shown with U+FFFD, not refused.
    std::cout << toJson(plist::Value(reply.dictionary())).dump(-1, ' ', false, nlohmann::json::error_handler_t::replace)
              << '\n';
    return;
  }
  switch (output) {
    case Output::Whole:
    case Output::Keys:
      for (const auto& [key, value] : reply.dictionary()) {
        bool wanted = output == Output::Whole ? key != "ReplyError"
                                              : std::find(keys.begin(), keys.end(), key) != keys.end();
        if (wanted) std::cout << key << ": " << plainText(value) << '\n';
      }
      if (output == Output::Whole && reply.ok()) std::cout << "ok\n";
      return;
    case Output::List:
      if (reply.ok()) printList(reply);
      return;
    case Output::Value:
      if (const plist::Value* v = reply.value(keys.front()); v && reply.ok()) std::cout << plainText(*v) << '\n';
      return;
    case Output::Lines:
      if (const plist::Array* a = reply.array(keys.front()); a && reply.ok())
        for (const plist::Value& e : *a) std::cout << plainText(e) << '\n';
      if (const plist::Dictionary* d = reply.dictionary(keys.front()); d && reply.ok())
        for (const auto& [k, e] : *d) std::cout << k << ' ' << plainText(e) << '\n';
      return;
  }
}

// ---- commands ---------------------------------------------------------------

std::unique_ptr<qk::Connection> connectOrExplain(const Options& options) {
  std::string error;
  auto connection = qk::Connection::connect(options.socketPath, &error);
  if (!connection) {
    std::cerr << "quarterctl: " << error << '\n';
    return nullptr;
  }
  connection->setReplyTimeout(options.timeout);
  return connection;
}

int finish(const qk::Connection& connection, const std::optional<qk::Reply>& reply, const Options& options,
           Output output = Output::Whole, const std::vector<std::string>& keys = {}) {
  if (!reply) {
    std::cerr << (connection.closed() ? "quarterctl: the daemon closed the connection without a reply\n"
                                      : "quarterctl: no reply in time, or a reply that is not a dictionary\n");
    return kExitUsage;
  }
  printReply(*reply, options, output, keys);
  if (reply->ok()) return kExitOK;
  std::cerr << "quarterctl: " << qk::describeResult(reply->error()) << '\n';
  return kExitReplyError;
}

int runRaw(const Options& options) {
  plist::Dictionary request;
  parseLong(options.args, 1, {{"file", required_argument, nullptr, 'f'}}, "raw", true, [&](int c, const char* arg) {
    if (c == 1) return addAssignment(arg, request);
    plist::Value file = readPlistFile(arg);
    if (!file.isDictionary()) throw UsageError{std::string(arg) + " does not hold a dictionary"};
    for (auto& [k, v] : file.dictionary()) request.insert_or_assign(k, v);
  });
  auto connection = connectOrExplain(options);
  if (!connection) return kExitUsage;
  return finish(*connection, qk::perform(*connection, qk::Request(std::move(request))), options);
}

// ---- container subcommands --------------------------------------------------

enum OptionBit : unsigned {
  kClass = 1u << 0,
  kUser = 1u << 1,
  kIdentifier = 1u << 2,
  kUUID = 1u << 3,
  kTransient = 1u << 4,
  kKey = 1u << 5,
  kValue = 1u << 6,
  kInfo = 1u << 7,
  kAddon = 1u << 8,
  kEntry = 1u << 9,
  kReplace = 1u << 10,  // every --old-* and --new-* option of replace but --new-class
  kNewClass = 1u << 11,
  kGroup = 1u << 12,
  kSystem = 1u << 13,
  kCodeSigning = 1u << 14,  // --entitlements, --cs-info or --remove
  kCodeSigningOptions = 1u << 15,
  kCrashes = 1u << 16,
  kSource = 1u << 17,
  kDest = 1u << 18,
  kRelative = 1u << 19,
  kOne = kClass | kUser | kIdentifier | kUUID,  // one existing container
  kOneRequired = kClass | kIdentifier | kUUID,
};

// What names one container; the user id defaults by class (ownerFor).
struct Side {
  std::optional<uint64_t> containerClass;
  std::optional<uint64_t> userId;
  std::optional<std::string> identifier;
  std::optional<QRTUUID> uuid;
};

struct StageEntry {
  uint64_t userId = 0;
  uint64_t containerClass = 0;
  QRTUUID uuid;
  std::string identifier;
};

struct Args {
  unsigned given = 0;
  Side self, old, replacement;
  std::optional<std::string> key;
  std::optional<plist::Value> value;
  bool transient = false;
  bool info = false;
  bool addon = false;
  std::vector<StageEntry> entries;
  std::optional<std::string> group;
  bool system = false;
  std::optional<plist::Value> codeSigningInfo;  // absent with --remove
  plist::Dictionary codeSigningOptions;
  uint64_t crashes = 0;
  std::optional<std::string> source, dest;
  bool relative = false;
};

plist::Value readDictionaryFile(const std::string& path) {
  plist::Value v = readPlistFile(path);
  if (!v.isDictionary()) throw UsageError{path + " does not hold a dictionary"};
  return v;
}

// The only user id the daemon accepts for bundle and system classes; for
// the others 1, which it reads as the current mobile user.
uint64_t ownerFor(uint64_t containerClass) {
  switch (containerClass) {
    case 1: case 3: case 5: case 8: return 33;
    case 12: case 13: return 499;
    default: return 1;
  }
}

qk::ContainerRef ref(const Side& side) {
  uint64_t containerClass = side.containerClass.value_or(0);
  return {side.userId.value_or(ownerFor(containerClass)), containerClass, side.identifier, side.uuid};
}

QRTUUID parseUUID(const std::string& text, const std::string& what) {
  auto uuid = QRTUUID::fromString(text);
  if (!uuid) throw UsageError{"not a UUID for " + what + ": " + text};
  return *uuid;
}

// USER:CLASS:UUID:IDENTIFIER; the identifier is the rest, colons and all.
StageEntry parseEntry(const std::string& text) {
  size_t a = text.find(':');
  size_t b = a == std::string::npos ? a : text.find(':', a + 1);
  size_t c = b == std::string::npos ? b : text.find(':', b + 1);
  if (c == std::string::npos) throw UsageError{"expected USER:CLASS:UUID:IDENTIFIER, got: " + text};
  return {parseUnsigned(text.substr(0, a), "--entry user"),
          parseUnsigned(text.substr(a + 1, b - a - 1), "--entry class"),
          parseUUID(text.substr(b + 1, c - b - 1), "--entry"), text.substr(c + 1)};
}

plist::Value parseTypedValue(const std::string& text) {
  size_t colon = text.find(':');
  if (colon == std::string::npos) throw UsageError{"expected --value TYPE:VALUE, got: " + text};
  return parseTyped(text.substr(0, colon), text.substr(colon + 1), "--value");
}

struct OptionRow {
  const char* flag;
  const char* valueName;  // nullptr: a switch
  unsigned bit;
  void (*set)(Args&, const std::string& value);
};

using Text = const std::string&;
const OptionRow kOptionTable[] = {
    {"--class", "N", kClass, [](Args& a, Text v) { a.self.containerClass = parseUnsigned(v, "--class"); }},
    {"--user", "N", kUser, [](Args& a, Text v) { a.self.userId = parseUnsigned(v, "--user"); }},
    {"--identifier", "ID", kIdentifier, [](Args& a, Text v) { a.self.identifier = v; }},
    {"--uuid", "UUID", kUUID, [](Args& a, Text v) { a.self.uuid = parseUUID(v, "--uuid"); }},
    {"--transient", nullptr, kTransient, [](Args& a, Text) { a.transient = true; }},
    {"--key", "K", kKey, [](Args& a, Text v) { a.key = v; }},
    {"--value", "TYPE:VALUE", kValue, [](Args& a, Text v) { a.value = parseTypedValue(v); }},
    {"--info", nullptr, kInfo, [](Args& a, Text) { a.info = true; }},
    {"--addon", nullptr, kAddon, [](Args& a, Text) { a.addon = true; }},
    {"--entry", "USER:CLASS:UUID:IDENTIFIER", kEntry, [](Args& a, Text v) { a.entries.push_back(parseEntry(v)); }},
    {"--old-uuid", "UUID", kReplace, [](Args& a, Text v) { a.old.uuid = parseUUID(v, "--old-uuid"); }},
    {"--old-class", "N", kReplace, [](Args& a, Text v) { a.old.containerClass = parseUnsigned(v, "--old-class"); }},
    {"--old-user", "N", kReplace, [](Args& a, Text v) { a.old.userId = parseUnsigned(v, "--old-user"); }},
    {"--old-identifier", "ID", kReplace, [](Args& a, Text v) { a.old.identifier = v; }},
    {"--new-uuid", "UUID", kReplace, [](Args& a, Text v) { a.replacement.uuid = parseUUID(v, "--new-uuid"); }},
    {"--new-class", "N", kNewClass,
     [](Args& a, Text v) { a.replacement.containerClass = parseUnsigned(v, "--new-class"); }},
    {"--new-user", "N", kReplace, [](Args& a, Text v) { a.replacement.userId = parseUnsigned(v, "--new-user"); }},
    {"--new-identifier", "ID", kReplace, [](Args& a, Text v) { a.replacement.identifier = v; }},
    {"--group", "GROUP", kGroup, [](Args& a, Text v) { a.group = v; }},
    {"--system", nullptr, kSystem, [](Args& a, Text) { a.system = true; }},
    {"--entitlements", "PLIST", kCodeSigning,
     [](Args& a, Text v) {
       a.codeSigningInfo = plist::Dictionary{{"com.norvane.QuarterKit.Entitlements", readDictionaryFile(v)}};
     }},
    {"--cs-info", "PLIST", kCodeSigning, [](Args& a, Text v) { a.codeSigningInfo = readDictionaryFile(v); }},
    {"--remove", nullptr, kCodeSigning, [](Args& a, Text) { a.codeSigningInfo.reset(); }},
    {"--data-class", "N", kCodeSigningOptions,
     [](Args& a, Text v) {
       a.codeSigningOptions["com.norvane.QuarterKit.DataContainerClass"] = parseUnsigned(v, "--data-class");
     }},
    {"--parent", "ID", kCodeSigningOptions,
     [](Args& a, Text v) { a.codeSigningOptions["com.norvane.QuarterKit.ParentBundleID"] = v; }},
    {"--placeholder", nullptr, kCodeSigningOptions,
     [](Args& a, Text) { a.codeSigningOptions["com.norvane.QuarterKit.PlaceholderEntitlements"] = true; }},
    {"--by-caller", nullptr, kCodeSigningOptions,
     [](Args& a, Text) { a.codeSigningOptions["RegByCaller"] = true; }},
    {"--crashes", "N", kCrashes, [](Args& a, Text v) { a.crashes = parseUnsigned(v, "--crashes"); }},
    {"--source", "PATH", kSource, [](Args& a, Text v) { a.source = v; }},
    {"--dest", "PATH", kDest, [](Args& a, Text v) { a.dest = v; }},
    {"--relative", nullptr, kRelative, [](Args& a, Text) { a.relative = true; }},
};

qk::Result createOrLookup(qk::Connection& c, const Args& a, bool create) {
  qk::ContainerRef r = ref(a.self);
  return qk::createOrLookupContainer(c, r.userId, r.identifier, r.containerClass, create, a.transient);
}

qk::Result stage(qk::Connection& c, const Args& a) {
  std::vector<uint64_t> users, classes;
  std::vector<QRTUUID> uuids;
  std::vector<std::string> identifiers;
  for (const StageEntry& e : a.entries) {
    users.push_back(e.userId);
    classes.push_back(e.containerClass);
    uuids.push_back(e.uuid);
    identifiers.push_back(e.identifier);
  }
  return qk::stageContainerForDelete(c, users, uuids, identifiers, classes);
}

qk::Result wipe(qk::Connection& c, const Args& a) {
  if (a.addon) return qk::wipeAddonDataContainer(c, a.self.userId.value_or(ownerFor(4)), a.self.identifier);
  qk::ContainerRef r = ref(a.self);
  return qk::deleteDataContainerContent(c, r.userId, r.identifier, r.containerClass);
}

qk::Result replace(qk::Connection& c, const Args& a) {
  bool hasOld = a.old.uuid || a.old.containerClass || a.old.userId || a.old.identifier;
  return qk::replaceContainer(c, hasOld ? std::optional<qk::ContainerRef>(ref(a.old)) : std::nullopt,
                              ref(a.replacement));
}

struct Subcommand {
  const char* name;  // one word, or two ("info get")
  uint64_t command;
  unsigned options;
  unsigned required;
  qk::Result (*send)(qk::Connection&, const Args&);
  Output output;
  std::vector<std::string> keys;
  const char* help;
};

using C = qk::Connection&;
using A = const Args&;
const std::vector<std::string> kContainerKeys = {"ReplyPath", "ReplyUUID", "ReplyExisted", "ReplyIdentifier"};

const Subcommand kSubcommands[] = {
    {"create", 0, kClass | kUser | kIdentifier | kTransient, kClass,
     [](C c, A a) { return createOrLookup(c, a, true); }, Output::Keys, kContainerKeys,
     "Creates the container, or finds it when it exists."},
    {"lookup", 0, kClass | kUser | kIdentifier | kTransient, kClass,
     [](C c, A a) { return createOrLookup(c, a, false); }, Output::Keys, kContainerKeys,
     "Finds an existing container; creates nothing."},
    {"list", 1, kClass | kUser | kTransient, kClass,
     [](C c, A a) { return qk::containersForUser(c, ref(a.self).userId, ref(a.self).containerClass, a.transient); },
     Output::List, {}, "Lists the containers of a class and user."},
    {"info get", 6, kOne | kKey, kOneRequired | kKey,
     [](C c, A a) { return qk::infoValueForKey(c, ref(a.self), *a.key); }, Output::Value, {"ReplyInfoValue"},
     "Prints one info value of a container."},
    {"info set", 5, kOne | kKey | kValue, kOneRequired | kKey,
     [](C c, A a) { return qk::setInfoValue(c, ref(a.self), *a.key, a.value); }, Output::Whole, {},
     "Sets an info value (TYPE:VALUE as for raw); without --value removes the key."},
    {"metadata", 7, kOne | kInfo, kOneRequired,
     [](C c, A a) { return qk::metadataForContainer(c, ref(a.self), a.info); }, Output::Keys,
     {"ReplyPath", "ReplyTransient", "ReplyInfoDictionary"},
     "Prints a container's path and transient flag; --info adds its info dictionary."},
    {"recreate", 8, kOne, kOneRequired, [](C c, A a) { return qk::recreateDefaultStructure(c, ref(a.self)); },
     Output::Whole, {}, "Creates the container's default sub-directories again."},
    {"recreate-structure", 22, kOne, kOneRequired,
     [](C c, A a) { return qk::recreateContainerStructure(c, ref(a.self)); }, Output::Whole, {},
     "The same as recreate, through its second command number."},
    {"regenerate-uuid", 9, kOne, kOneRequired, [](C c, A a) { return qk::regenerateDirectoryUUID(c, ref(a.self)); },
     Output::Whole, {}, "Gives the container's directory a new name; the internal UUID stays."},
    {"delete", 10, kClass | kUser | kIdentifier | kTransient, kClass | kIdentifier,
     [](C c, A a) {
       qk::ContainerRef r = ref(a.self);
       return qk::deleteContainer(c, r.userId, r.identifier, r.containerClass, a.transient);
     },
     Output::Whole, {}, "Stages a container for deletion (see deathrow)."},
    {"stage", 3, kEntry, kEntry, stage, Output::Whole, {},
     "Stages containers for deletion, one --entry per container (repeat it)."},
    {"wipe", 12, kClass | kUser | kIdentifier | kAddon, kClass | kIdentifier, wipe, Output::Whole, {},
     "Replaces a data container's content by fresh content; --addon wipes a\n"
     "      class 4 container under the wipeContainer entitlement (command 11), with no --class."},
    {"replace", 2, kReplace | kNewClass, kNewClass, replace, Output::Whole, {},
     "Puts the new container in the old one's place; without --old-uuid it\n"
     "      makes a transient container permanent."},
    {"deathrow", 4, 0, 0, [](C c, A) { return qk::deleteContainersOnDeathRow(c); }, Output::Whole, {},
     "Destroys everything staged for deletion; answers when the pass is done."},
    {"du", 23, kOne, kOneRequired, [](C c, A a) { return qk::diskUsage(c, ref(a.self)); }, Output::Value,
     {"ReplyDiskUsage"}, "Prints the bytes a container uses."},
    {"system-path", 15, kIdentifier, 0, [](C c, A a) { return qk::systemContainerPath(c, a.self.identifier); },
     Output::Keys, kContainerKeys, "Creates or looks up a system container (class 12, user 499)."},
    {"groups paths", 13, kUser | kIdentifier | kSystem, 0,
     [](C c, A a) {
       return a.system ? qk::systemGroupContainerPaths(c, a.self.identifier)
                       : qk::groupContainerPaths(c, a.self.userId.value_or(1), a.self.identifier);
     },
     Output::Lines, {"ReplyGroupContainerDict"},
     "Prints \"GROUP PATH\" for each group container of a program, creating them;\n"
     "      --system for its system group containers (command 16, user 499)."},
    {"groups ids", 14, kUser | kIdentifier, 0,
     [](C c, A a) { return qk::groupContainerIdentifiers(c, a.self.userId.value_or(1), a.self.identifier); },
     Output::Lines, {"ReplyGroupIdentifiersArray"}, "Prints the application group identifiers of a program."},
    {"system-group-path", 17, kGroup | kIdentifier, kGroup,
     [](C c, A a) { return qk::systemGroupContainerPath(c, *a.group, a.self.identifier); }, Output::Value,
     {"ReplyPath"}, "Creates or looks up a system group container the caller is entitled to."},
    {"codesign set", 18, kIdentifier | kCodeSigning | kCodeSigningOptions, kIdentifier | kCodeSigning,
     [](C c, A a) {
       return qk::processCodeSigningInfo(c, a.self.identifier, a.codeSigningInfo,
                                         plist::Value(a.codeSigningOptions));
     },
     Output::Whole, {},
     "Registers a program's code-signing information, given by one of: --entitlements, which\n"
     "      wraps an entitlements dictionary; --cs-info, a whole code-signing dictionary; --remove,\n"
     "      which deletes the entry and what only it kept alive."},
    {"codesign get", 19, kIdentifier, kIdentifier,
     [](C c, A a) { return qk::codeSigningInfoForIdentifier(c, a.self.identifier); }, Output::Value,
     {"ReplyInfoDictionary"}, "Prints a program's registered code-signing information."},
    {"codesign invalidate-missing", 20, 0, 0,
     [](C c, A) { return qk::invalidateCodeSigningInfoForAppsWithoutBundleContainer(c); }, Output::Whole, {},
     "Invalidates the entries of programs that have no bundle container."},
    {"migrate", 24, 0, 0, [](C c, A) { return qk::performDataMigration(c); }, Output::Whole, {},
     "Runs the data migration: ACLs, bundle ownership and the code-signing imports, each once."},
    {"retry-test", 25, kUser | kCrashes, 0,
     [](C c, A a) { return qk::retryTest(c, a.self.userId.value_or(ownerFor(2)), a.crashes); }, Output::Whole, {},
     "Internal builds: ends the daemon --crashes times, then removes the test container."},
    {"stage-shared", 26, kIdentifier | kSource | kDest, kIdentifier | kSource | kDest,
     [](C c, A a) { return qk::stageSharedContent(c, a.self.identifier, a.source, a.dest); }, Output::Keys,
     {"ReplyPath"}, "Moves --source to --dest inside a system group container."},
    {"network-extension", 27, kIdentifier | kClass, kIdentifier | kClass,
     [](C c, A a) { return qk::setNetworkExtension(c, a.self.identifier, a.self.containerClass.value_or(0)); },
     Output::Whole, {}, "Makes a VPN plug-in's data container and maps it for the tunnel worker."},
    {"assets-path", 28, kIdentifier | kRelative, kIdentifier,
     [](C c, A a) { return qk::userManagedAssetsPath(c, a.self.identifier, a.relative); }, Output::Keys,
     {"ReplyPath"}, "Prints (making it on first use) an application's user-managed assets directory."},
    {"assets-delete", 29, kIdentifier | kSource, kIdentifier | kSource,
     [](C c, A a) { return qk::deleteUserManagedAsset(c, a.self.identifier, a.source); }, Output::Whole, {},
     "Moves one user-managed asset (--source, relative to the assets directory) to death row."},
};

// The subcommand named by the first one or two words; *words says how many.
const Subcommand* findSubcommand(const std::vector<std::string>& args, size_t* words) {
  for (const Subcommand& row : kSubcommands) {
    std::string_view name = row.name;
    size_t space = name.find(' ');
    if (space == std::string_view::npos ? args[0] == name
                                        : args.size() > 1 && args[0] == name.substr(0, space) &&
                                              args[1] == name.substr(space + 1)) {
      *words = space == std::string_view::npos ? 1 : 2;
      return &row;
    }
  }
  return nullptr;
}

Args parseArgs(const Subcommand& row, const std::vector<std::string>& args, size_t first) {
  Args a;
  std::vector<option> longs;
  constexpr int kBase = 1000;
  for (size_t i = 0; i < std::size(kOptionTable); ++i) {
    const OptionRow& entry = kOptionTable[i];
    if (entry.bit & row.options)
      longs.push_back({entry.flag + 2, entry.valueName ? required_argument : no_argument, nullptr,
                       kBase + static_cast<int>(i)});
  }
  parseLong(args, first, longs, row.name, false, [&](int c, const char* value) {
    const OptionRow& entry = kOptionTable[c - kBase];
    entry.set(a, value ? value : "");
    a.given |= entry.bit;
  });
  unsigned missing = row.required & ~a.given;
  if (a.addon) missing &= ~kClass;  // the addon wipe always works on class 4
  for (const OptionRow& option : kOptionTable)
    if (option.bit & missing) throw UsageError{std::string(row.name) + " needs " + option.flag};
  return a;
}

int runSubcommand(const Subcommand& row, size_t words, const Options& options) {
  Args a = parseArgs(row, options.args, words);
  auto connection = connectOrExplain(options);
  if (!connection) return kExitUsage;
  return finish(*connection, row.send(*connection, a), options, row.output, row.keys);
}

// ---- protect (command 21) -------------------------------------------------

const char kProtectUsage[] = R"(  protect --identifier ID --protection-class N [--class N] [--user N] [--third-party]
          [--retry-if-locked]
      (command 21) Sets the protection class of every item of a data container's Documents,
      Library, tmp and Purchases (--class defaults to 2). The reply comes when the change is
      done; with --retry-if-locked a locked device holds it until the next unlock.
)";

int runProtect(const Options& options) {
  std::optional<std::string> identifier;
  std::optional<int64_t> protectionClass;
  uint64_t containerClass = 2;
  std::optional<uint64_t> userId;
  bool thirdParty = false, retryIfLocked = false;
  enum { kIdentifierOpt = 1000, kProtection, kClassOpt, kUserOpt, kThirdParty, kRetry };
  const std::vector<option> longs = {
      {"identifier", required_argument, nullptr, kIdentifierOpt}, {"protection-class", required_argument, nullptr, kProtection},
      {"class", required_argument, nullptr, kClassOpt},           {"user", required_argument, nullptr, kUserOpt},
      {"third-party", no_argument, nullptr, kThirdParty},         {"retry-if-locked", no_argument, nullptr, kRetry},
  };
  parseLong(options.args, 1, longs, "protect", false, [&](int c, const char* value) {
    switch (c) {
      case kIdentifierOpt: identifier = value; break;
      case kProtection: protectionClass = parseSigned(value, "--protection-class"); break;
      case kClassOpt: containerClass = parseUnsigned(value, "--class"); break;
      case kUserOpt: userId = parseUnsigned(value, "--user"); break;
      case kThirdParty: thirdParty = true; break;
      case kRetry: retryIfLocked = true; break;
    }
  });
  if (!identifier) throw UsageError{"protect needs --identifier"};
  if (!protectionClass) throw UsageError{"protect needs --protection-class"};
  auto connection = connectOrExplain(options);
  if (!connection) return kExitUsage;
  return finish(*connection,
                qk::setDataProtection(*connection, userId.value_or(ownerFor(containerClass)), identifier,
                                      containerClass, *protectionClass, thirdParty, retryIfLocked),
                options);
}

std::string usageText() {
  std::string out = kUsageHead;
  for (const Subcommand& row : kSubcommands) {
    std::string line = "  " + std::string(row.name);
    for (const OptionRow& entry : kOptionTable) {
      if (!(entry.bit & row.options)) continue;
      std::string option = entry.flag;
      if (entry.valueName) option += std::string(" ") + entry.valueName;
      option = (entry.bit & row.required) ? " " + option : " [" + option + "]";
      if (line.size() + option.size() > 92) {
        out += line + '\n';
        line = "       ";
      }
      line += option;
    }
    out += line + "\n      (command " + std::to_string(row.command) + ") " + row.help + '\n';
  }
  return out + kProtectUsage + kUsageTail;
}

// Global options stop at the first word that is not one.
Options parseOptions(int argc, char** argv) {
  Options options;
  if (const char* root = getenv("QUARTERD_ROOT"); root && *root) options.socketPath = qk::requestSocketPath(root);
  enum { kRoot = 1000, kSocket, kJson, kTimeout };
  static const option kLong[] = {
      {"root", required_argument, nullptr, kRoot}, {"socket", required_argument, nullptr, kSocket},
      {"json", no_argument, nullptr, kJson},       {"timeout", required_argument, nullptr, kTimeout},
      {"help", no_argument, nullptr, 'h'},         {"version", no_argument, nullptr, 'V'},
      {nullptr, 0, nullptr, 0},
  };
  opterr = 0;
  for (int c; (c = getopt_long(argc, argv, "+:hV", kLong, nullptr)) != -1;) {
    switch (c) {
      case kRoot: options.socketPath = qk::requestSocketPath(optarg); break;
      case kSocket: options.socketPath = optarg; break;
      case kJson: options.json = true; break;
      case kTimeout: options.timeout = std::chrono::seconds(parseUnsigned(optarg, "--timeout")); break;
      case 'h': options.help = true; break;
      case 'V': options.version = true; break;
      case ':': throw UsageError{std::string(argv[optind - 1]) + " needs a value"};
      default: throw UsageError{"unknown option " + std::string(argv[optind - 1])};
    }
  }
  options.args.assign(argv + optind, argv + argc);
  return options;
}

int run(int argc, char** argv) {
  Options options = parseOptions(argc, argv);
  if (options.version) {
    std::cout << "quarterctl " << QRT_VERSION << '\n';
    return kExitOK;
  }
  if (options.help) {
    std::cout << usageText();
    return kExitOK;
  }
  if (options.args.empty()) throw UsageError{"no command given"};
  const std::string& command = options.args[0];
  bool help = command == "help" ||
              std::any_of(options.args.begin(), options.args.end(), [](const std::string& a) {
                return a == "-h" || a == "--help";
              });
  if (help) {
    std::cout << usageText();
    return kExitOK;
  }
  if (command == "raw") return runRaw(options);
  if (command == "protect") return runProtect(options);
  size_t words = 0;
  if (const Subcommand* row = findSubcommand(options.args, &words)) return runSubcommand(*row, words, options);
  if (command == "info") throw UsageError{"info needs get or set"};
  throw UsageError{"unknown command " + command};
}

}  // namespace

int main(int argc, char** argv) {
  try {
    return run(argc, argv);
  } catch (const UsageError& e) {
    std::cerr << "quarterctl: " << e.message << "\n(quarterctl --help for usage)\n";
  } catch (const std::exception& e) {
    std::cerr << "quarterctl: " << e.what() << '\n';
  }
  return kExitUsage;
}
