// quarterctl: sends requests to quarterd and prints the replies, for people
// and for scripts (--json). Exit status: 0 success, 1 the daemon answered
// with an error, 2 usage or connection trouble.
#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <iostream>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "QuarterKit/QuarterKit.h"
#include "QuarterKit/Requests.h"
#include "base/PlistCodec.h"
#include "base/QRTUUID.h"

namespace {

constexpr int kExitOK = 0;
constexpr int kExitReplyError = 1;
constexpr int kExitUsage = 2;
constexpr size_t kMaxPlistFile = 64u * 1024 * 1024;

const char kUsage[] = R"(usage: quarterctl [--root DIR | --socket PATH] [--json] [--timeout SECONDS] COMMAND ...

Sends one request to quarterd and prints its reply.

Options:
  --root DIR         talk to the daemon of device root DIR (socket DIR/run/com.norvane.quarterd)
  --socket PATH      talk to the request socket at PATH (default /run/com.norvane.quarterd)
  --json             print the reply as a JSON object: integers as numbers, 16-byte data as
                     UUID strings, other data as base64 strings, dates as ISO 8601 strings
  --timeout SECONDS  how long to wait for the reply (default 60)
  -h, --help         this text

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
  create --class N [--user N] [--identifier ID] [--transient]
  lookup --class N [--user N] [--identifier ID] [--transient]
      Creates or looks up (command 0) the container of class N for user N (default 1, the
      current mobile user) and identifier ID (default: the caller's own).
  system-path [--identifier ID]
      Creates or looks up a system container (command 15).

Output: one "Key: value" line per reply key, sorted; 16-byte data is shown as a UUID and
nested values in the old-style property-list text form. create, lookup and system-path
print Path, UUID, Existed and Identifier where the reply has them.

Exit status: 0 when the reply's ReplyError is 1, 1 when it is another value, 2 on usage
errors, connection failures and when no reply came.
)";

struct Options {
  std::string socketPath = qk::requestSocketPath("/");
  bool json = false;
  std::chrono::milliseconds timeout = std::chrono::seconds(60);
  std::vector<std::string> args;  // the command and its arguments
};

struct UsageError {
  std::string message;
};

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

void jsonString(const std::string& s, std::string& out) {
  out += '"';
  for (unsigned char c : s) {
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      default:
        if (c < 0x20) {
          char buf[8];
          snprintf(buf, sizeof buf, "\\u%04x", c);
          out += buf;
        } else {
          out += static_cast<char>(c);
        }
    }
  }
  out += '"';
}

void json(const plist::Value& v, std::string& out) {
  switch (v.type()) {
    case plist::Type::Boolean: out += v.boolean() ? "true" : "false"; return;
    case plist::Type::Integer: out += integerText(v.integer()); return;
    case plist::Type::Real: out += std::isfinite(v.real()) ? realText(v.real()) : "null"; return;
    case plist::Type::Date: return jsonString(dateText(v.date()), out);
    case plist::Type::String: return jsonString(v.string(), out);
    case plist::Type::Data: return jsonString(uuidText(v).value_or(base64(v.data())), out);
    case plist::Type::Array: {
      out += '[';
      const char* sep = "";
      for (const plist::Value& e : v.array()) {
        out += std::exchange(sep, ",");
        json(e, out);
      }
      out += ']';
      return;
    }
    case plist::Type::Dictionary: {
      out += '{';
      const char* sep = "";
      for (const auto& [k, e] : v.dictionary()) {
        out += std::exchange(sep, ",");
        jsonString(k, out);
        out += ':';
        json(e, out);
      }
      out += '}';
      return;
    }
  }
}

void printReply(const qk::Reply& reply, const Options& options, const std::vector<std::string>& only = {}) {
  if (options.json) {
    std::string out;
    json(plist::Value(reply.dictionary()), out);
    std::cout << out << '\n';
    return;
  }
  for (const auto& [key, value] : reply.dictionary()) {
    bool wanted = only.empty() || std::find(only.begin(), only.end(), key) != only.end();
    if (wanted) std::cout << key << ": " << plainText(value) << '\n';
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
           const std::vector<std::string>& only = {}) {
  if (!reply) {
    std::cerr << (connection.closed() ? "quarterctl: the daemon closed the connection without a reply\n"
                                      : "quarterctl: no reply in time, or a reply that is not a dictionary\n");
    return kExitUsage;
  }
  printReply(*reply, options, only);
  if (reply->ok()) return kExitOK;
  if (!options.json && !only.empty()) std::cerr << "quarterctl: request failed: ReplyError " << reply->error() << '\n';
  return kExitReplyError;
}

int runRaw(const Options& options) {
  plist::Dictionary request;
  const auto& args = options.args;
  for (size_t i = 1; i < args.size(); ++i) {
    if (args[i] == "--file") {
      if (++i == args.size()) throw UsageError{"--file needs a path"};
      plist::Value file = readPlistFile(args[i]);
      if (!file.isDictionary()) throw UsageError{args[i] + " does not hold a dictionary"};
      for (auto& [k, v] : file.dictionary()) request.insert_or_assign(k, v);
    } else {
      addAssignment(args[i], request);
    }
  }
  auto connection = connectOrExplain(options);
  if (!connection) return kExitUsage;
  return finish(*connection, qk::perform(*connection, qk::Request(std::move(request))), options);
}

const std::vector<std::string> kContainerKeys = {"ReplyPath", "ReplyUUID", "ReplyExisted", "ReplyIdentifier"};

// create, lookup and system-path share their flags.
struct ContainerArgs {
  std::optional<uint64_t> containerClass;
  uint64_t userId = 1;
  std::optional<std::string> identifier;
  bool transient = false;
};

ContainerArgs parseContainerArgs(const std::vector<std::string>& args, bool classAndUser) {
  ContainerArgs out;
  for (size_t i = 1; i < args.size(); ++i) {
    const std::string& a = args[i];
    auto next = [&]() -> const std::string& {
      if (i + 1 == args.size()) throw UsageError{a + " needs a value"};
      return args[++i];
    };
    if (a == "--identifier") out.identifier = next();
    else if (classAndUser && a == "--class") out.containerClass = parseUnsigned(next(), a);
    else if (classAndUser && a == "--user") out.userId = parseUnsigned(next(), a);
    else if (classAndUser && a == "--transient") out.transient = true;
    else throw UsageError{"unknown argument to " + args[0] + ": " + a};
  }
  if (classAndUser && !out.containerClass) throw UsageError{args[0] + " needs --class"};
  return out;
}

int runCreateOrLookup(const Options& options, bool create) {
  ContainerArgs a = parseContainerArgs(options.args, true);
  auto connection = connectOrExplain(options);
  if (!connection) return kExitUsage;
  auto reply =
      qk::createOrLookupContainer(*connection, a.userId, a.identifier, *a.containerClass, create, a.transient);
  return finish(*connection, reply, options, kContainerKeys);
}

int runSystemPath(const Options& options) {
  ContainerArgs a = parseContainerArgs(options.args, false);
  auto connection = connectOrExplain(options);
  if (!connection) return kExitUsage;
  return finish(*connection, qk::systemContainerPath(*connection, a.identifier), options, kContainerKeys);
}

// Global options stop at the first word that is not one.
Options parseOptions(int argc, char** argv) {
  Options options;
  int i = 1;
  for (; i < argc; ++i) {
    std::string a = argv[i];
    auto next = [&]() -> std::string {
      if (i + 1 == argc) throw UsageError{a + " needs a value"};
      return argv[++i];
    };
    if (a == "--root") options.socketPath = qk::requestSocketPath(next());
    else if (a == "--socket") options.socketPath = next();
    else if (a == "--json") options.json = true;
    else if (a == "--timeout") options.timeout = std::chrono::seconds(parseUnsigned(next(), a));
    else if (a.size() > 1 && a[0] == '-' && a != "-h" && a != "--help") throw UsageError{"unknown option " + a};
    else break;
  }
  options.args.assign(argv + i, argv + argc);
  return options;
}

int run(int argc, char** argv) {
  Options options = parseOptions(argc, argv);
  if (options.args.empty()) throw UsageError{"no command given"};
  const std::string& command = options.args[0];
  for (const std::string& a : options.args) {
    if (a == "-h" || a == "--help") {
      std::cout << kUsage;
      return kExitOK;
    }
  }
  if (command == "help") {
    std::cout << kUsage;
    return kExitOK;
  }
  if (command == "raw") return runRaw(options);
  if (command == "create") return runCreateOrLookup(options, true);
  if (command == "lookup") return runCreateOrLookup(options, false);
  if (command == "system-path") return runSystemPath(options);
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
