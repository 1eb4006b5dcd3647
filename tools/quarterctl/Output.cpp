// Replies shown to people and to scripts.
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <iostream>

#include "Cli.h"
#include "QuarterKit/Errors.h"

namespace ctl {

namespace {

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

// The length of a valid UTF-8 sequence at text[i] and its code point; 0 when
// it is not one.
size_t decodeUtf8(std::string_view text, size_t i, uint32_t* point) {
  const auto byte = [&](size_t k) { return static_cast<unsigned char>(text[k]); };
  const unsigned char b = byte(i);
  size_t n = b < 0x80 ? 1 : (b >> 5) == 6 ? 2 : (b >> 4) == 14 ? 3 : (b >> 3) == 30 ? 4 : 0;
  if (n == 0 || i + n > text.size()) return 0;
  uint32_t p = n == 1 ? b : b & (0x7f >> n);
  for (size_t k = 1; k < n; ++k) {
    if ((byte(i + k) & 0xc0) != 0x80) return 0;
    p = p << 6 | (byte(i + k) & 0x3f);
  }
  static const uint32_t kLeast[] = {0, 0, 0x80, 0x800, 0x10000};
  if (p < kLeast[n] || p > 0x10ffff || (p >= 0xd800 && p <= 0xdfff)) return 0;
  *point = p;
  return n;
}

// Characters that end a line, steer the terminal or reorder text.
bool invisible(uint32_t p) {
  return p < 0x20 || (p >= 0x7f && p <= 0x9f) || p == 0x2028 || p == 0x2029 || (p >= 0x202a && p <= 0x202e) ||
         (p >= 0x2066 && p <= 0x2069);
}

size_t displayWidth(std::string_view text) {
  size_t width = 0;
  for (unsigned char c : text) width += (c & 0xc0) != 0x80;
  return width;
}

}  // namespace

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

std::string printable(std::string_view text) {
  std::string out;
  char buf[16];
  for (size_t i = 0; i < text.size();) {
    uint32_t p = 0;
    size_t n = decodeUtf8(text, i, &p);
    if (n == 0) {
      snprintf(buf, sizeof buf, "\\x%02x", static_cast<unsigned char>(text[i]));
      out += buf;
      i += 1;
      continue;
    }
    if (p == '\\')
      out += "\\\\";
    else if (p == '\n')
      out += "\\n";
    else if (p == '\t')
      out += "\\t";
    else if (p == '\r')
      out += "\\r";
    else if (invisible(p)) {
      snprintf(buf, sizeof buf, p < 0x80 ? "\\x%02x" : "\\u%04x", static_cast<unsigned>(p));
      out += buf;
    } else {
      out.append(text.substr(i, n));
    }
    i += n;
  }
  return out;
}

void Table::print() const {
  std::vector<std::vector<std::string>> shown;
  std::vector<size_t> widths;
  for (const auto& row : rows_) {
    shown.emplace_back();
    for (size_t c = 0; c < row.size(); ++c) {
      shown.back().push_back(printable(row[c]));
      if (widths.size() <= c) widths.push_back(0);
      widths[c] = std::max(widths[c], displayWidth(shown.back().back()));
    }
  }
  for (const auto& row : shown) {
    std::string line;
    for (size_t c = 0; c < row.size(); ++c) {
      line += row[c];
      if (c + 1 < row.size()) line.append(widths[c] - displayWidth(row[c]) + 2, ' ');
    }
    std::cout << line << '\n';
  }
}

std::string sizeText(uint64_t bytes, bool units) {
  if (!units || bytes < 1024) return std::to_string(bytes) + (units ? " B" : "");
  static const char* const kUnits[] = {"KiB", "MiB", "GiB", "TiB", "PiB", "EiB"};
  double value = static_cast<double>(bytes) / 1024;
  size_t unit = 0;
  for (; value >= 1024 && unit + 1 < std::size(kUnits); ++unit) value /= 1024;
  char buf[32];
  snprintf(buf, sizeof buf, value < 10 ? "%.1f %s" : "%.0f %s", value, kUnits[unit]);
  return buf;
}

namespace {

std::unique_ptr<qk::Connection> connectOrExplain(const Global& global) {
  std::string error;
  auto connection = qk::Connection::connect(global.socketPath, &error);
  if (!connection) {
    const int err = errno;
    std::cerr << "quarterctl: " << printable(error) << '\n';
    if (err == ENOENT || err == ECONNREFUSED) {
      if (global.deviceRoot.empty() || global.socketGiven)
        std::cerr << "quarterctl: is quarterd running? try: systemctl status quarterd\n";
      else
        std::cerr << "quarterctl: is quarterd running on this device root? start it with: quarterd --root "
                  << printable(global.deviceRoot) << '\n';
    }
    return nullptr;
  }
  connection->setReplyTimeout(global.timeout);
  return connection;
}

void printJson(const nlohmann::json& value) {
  // A string the daemon sent that is not UTF-8 is shown with U+FFFD, not refused.
  std::cout << value.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace) << '\n';
}

int reportError(const qk::Reply& reply, const Global& global, const Show& show) {
  const uint64_t code = reply.error();
  const char* text = qk::errorText(code);
  if (global.json) {
    const char* name = qk::errorName(code);
    printJson({{"error",
                {{"code", code},
                 {"name", name ? nlohmann::json(name) : nlohmann::json(nullptr)},
                 {"message", text ? text : "unknown error"}}}});
    return kExitReplyError;
  }
  std::cerr << "quarterctl: " << qk::describeResult(code) << '\n';
  for (const auto& [hinted, hint] : show.hints)
    if (hinted == code) std::cerr << "quarterctl: " << hint << '\n';
  return kExitReplyError;
}

// Every reply key but ReplyError.
plist::Dictionary otherKeys(const qk::Reply& reply) {
  plist::Dictionary out = reply.dictionary();
  out.erase(QRTReplyKeyError);
  return out;
}

}  // namespace

int deliver(const Global& global, const Send& send, const Show& show) {
  auto connection = connectOrExplain(global);
  if (!connection) return kExitUsage;
  const qk::Result reply = send(*connection);
  if (!reply) {
    std::cerr << (connection->closed() ? "quarterctl: the daemon closed the connection without a reply\n"
                                       : "quarterctl: no reply in time, or a reply that is not a dictionary\n");
    return kExitUsage;
  }
  if (!reply->ok()) return reportError(*reply, global, show);
  if (global.json) {
    printJson(show.json ? show.json(*reply) : toJson(plist::Value(otherKeys(*reply))));
  } else if (show.human) {
    show.human(*reply);
  } else {
    plist::Dictionary keys = otherKeys(*reply);
    if (keys.empty()) {
      std::cout << "ok\n";
    } else {
      Table table({"KEY", "VALUE"});
      for (const auto& [key, value] : keys) table.add({key, plainText(value)});
      table.print();
    }
  }
  return kExitOK;
}

qk::Result resolve(qk::Connection& c, qk::ContainerRef& r) {
  if (r.uuid) return qk::Reply(plist::Dictionary{{QRTReplyKeyError, 1}});
  qk::Result found = qk::createOrLookupContainer(c, r.userId, r.identifier, r.containerClass, false, false);
  if (found && found->ok()) {
    r.uuid = found->uuid(QRTReplyKeyUUID);
    if (auto identifier = found->string(QRTReplyKeyIdentifier)) r.identifier = identifier;
  }
  return found;
}

}  // namespace ctl
