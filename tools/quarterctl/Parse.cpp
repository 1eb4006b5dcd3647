// Words of the command line into values and requests.
#include <getopt.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <fstream>

#include "Cli.h"
#include "base/PlistCodec.h"

namespace ctl {

namespace {

// A request frame holds at most 16 MiB; the daemon drops a larger one
// without an answer. A file for one fills most of it.
constexpr size_t kMaxMessage = 16u * 1024 * 1024 - 8;
constexpr uint64_t kMaxUser = 4294967294u;  // 2^32 - 1 is no user
constexpr size_t kMaxIdentifier = 255;

const char* const kClassNames[] = {
    nullptr, "app-bundle", "app-data",      "addon-bundle",    "addon-data", "vpn-bundle", "vpn-data",
    "group", "framework",  "relay-service", "internal-daemon", "temp-dir",   "system",     "system-group",
};

}  // namespace

bool Args::has(std::string_view flag) const {
  for (const auto& [name, v] : given)
    if (name == flag) return true;
  return false;
}

std::optional<std::string> Args::value(std::string_view flag) const {
  std::optional<std::string> out;
  for (const auto& [name, v] : given)
    if (name == flag) out = v;
  return out;
}

std::vector<std::string> Args::values(std::string_view flag) const {
  std::vector<std::string> out;
  for (const auto& [name, v] : given)
    if (name == flag) out.push_back(v);
  return out;
}

void parseLong(const std::vector<std::string>& args, size_t first, const std::vector<LongOption>& longs,
               const std::string& context, bool words, const std::function<void(int, const char*)>& onOption) {
  std::vector<std::string> storage{context};
  storage.insert(storage.end(), args.begin() + static_cast<std::ptrdiff_t>(first), args.end());
  std::vector<char*> argv;
  for (std::string& a : storage) argv.push_back(a.data());
  argv.push_back(nullptr);
  std::vector<option> table;
  for (const LongOption& o : longs)
    table.push_back({o.name, o.hasValue ? required_argument : no_argument, nullptr, o.val});
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

QRTUUID parseUUID(const std::string& text, const std::string& what) {
  auto uuid = QRTUUID::fromString(text);
  if (!uuid) throw UsageError{"not a UUID for " + what + ": " + text};
  return *uuid;
}

namespace {

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

}  // namespace

plist::Value readPlistFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) throw UsageError{"cannot read " + path + ": " + strerror(errno)};
  std::string bytes;
  char chunk[65536];
  while (in.read(chunk, sizeof chunk) || in.gcount() > 0) {
    bytes.append(chunk, static_cast<size_t>(in.gcount()));
    if (bytes.size() > kMaxMessage) throw UsageError{path + " is larger than the 16 MiB limit of a request"};
  }
  std::string error;
  auto value = plist::parse(bytes.data(), bytes.size(), &error);
  if (!value) throw UsageError{path + " is not a property list: " + error};
  return std::move(*value);
}

plist::Value readDictionaryFile(const std::string& path) {
  plist::Value v = readPlistFile(path);
  if (!v.isDictionary()) throw UsageError{path + " does not hold a dictionary"};
  return v;
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
  if (type == "uuid") return qk::uuidValue(parseUUID(text, key));
  if (type == "data") return plist::Value(parseHex(text, key));
  if (type == "plist") return readPlistFile(text);
  throw UsageError{"unknown type '" + type + "' for " + key + " (u64, i64, bool, str, uuid, data, plist)"};
}

void addAssignment(const std::string& arg, plist::Dictionary& request) {
  size_t eq = arg.find('=');
  size_t colon = eq == std::string::npos ? std::string::npos : arg.find(':', eq + 1);
  if (eq == std::string::npos || eq == 0 || colon == std::string::npos)
    throw UsageError{"expected KEY=TYPE:VALUE, got: " + arg};
  std::string key = arg.substr(0, eq);
  request.insert_or_assign(key, parseTyped(arg.substr(eq + 1, colon - eq - 1), arg.substr(colon + 1), key));
}

uint64_t parseUser(const std::string& text, const std::string& what) {
  uint64_t v = parseUnsigned(text, what);
  if (v > kMaxUser) throw UsageError{what + " " + text + " is out of range: user ids are 0 to 4294967294"};
  return v;
}

uint64_t parseClass(const std::string& text, const std::string& what) {
  for (uint64_t n = 1; n < std::size(kClassNames); ++n)
    if (text == kClassNames[n]) return n;
  if (!text.empty() && isdigit(static_cast<unsigned char>(text[0]))) {
    uint64_t n = parseUnsigned(text, what);
    if (n >= 1 && n < std::size(kClassNames)) return n;
  }
  throw UsageError{"unknown class for " + what + ": " + text + "; one of " + classList()};
}

std::string className(uint64_t containerClass) {
  return containerClass >= 1 && containerClass < std::size(kClassNames) ? kClassNames[containerClass]
                                                                        : std::to_string(containerClass);
}

std::string classList() {
  std::string out;
  for (uint64_t n = 1; n < std::size(kClassNames); ++n)
    out += (n > 1 ? ", " : "") + std::string(kClassNames[n]) + " (" + std::to_string(n) + ")";
  return out;
}

std::string checkIdentifier(const std::string& text, const std::string& what) {
  if (text.empty()) throw UsageError{what + " is empty"};
  if (text.size() > kMaxIdentifier)
    throw UsageError{what + " is " + std::to_string(text.size()) + " bytes, longer than the 255-byte limit"};
  for (unsigned char c : text)
    if (c < 0x20 || c == 0x7f) throw UsageError{what + " holds a control character: " + text};
  return text;
}

void checkMessageSize(const plist::Value& message, const std::string& what) {
  if (plist::writeBinary(message).size() > kMaxMessage)
    throw UsageError{what + " is larger than the 16 MiB limit of a request"};
}

uint64_t ownerFor(uint64_t containerClass) {
  switch (containerClass) {
    case 1:
    case 3:
    case 5:
    case 8: return 33;
    case 12:
    case 13: return 499;
    default: return 1;
  }
}

qk::ContainerRef containerArgs(const Args& a, const std::string& prefix) {
  qk::ContainerRef r;
  if (auto v = a.value(prefix + "class")) r.containerClass = parseClass(*v, prefix + "class");
  r.userId = ownerFor(r.containerClass);
  if (auto v = a.value(prefix + "user")) {
    r.userId = parseUser(*v, prefix + "user");
    // The daemon answers only "invalid argument" to these.
    if (ownerFor(r.containerClass) != 1 && r.userId != ownerFor(r.containerClass))
      throw UsageError{"class " + className(r.containerClass) + " belongs to user " +
                       std::to_string(ownerFor(r.containerClass)) + "; leave out " + prefix + "user"};
  }
  if (auto v = a.value(prefix + "identifier")) r.identifier = checkIdentifier(*v, prefix + "identifier");
  if (auto v = a.value(prefix + "uuid")) r.uuid = parseUUID(*v, prefix + "uuid");
  return r;
}

}  // namespace ctl
