// Replies shown to people and to scripts.
#include <algorithm>
#include <cmath>
#include <cstdio>
#include <ctime>
#include <iostream>

#include <nlohmann/json.hpp>

#include "Cli.h"
#include "QuarterKit/Errors.h"
#include "base/PlistCodec.h"

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


void printList(const qk::Reply& reply) {
  const plist::Array* ids = reply.array("ReplyIdsArray");
  const plist::Array* uuids = reply.array("ReplyUUIDsArray");
  if (!ids || !uuids) return;
  for (size_t i = 0; i < std::min(ids->size(), uuids->size()); ++i)
    std::cout << plainText((*ids)[i]) << ' ' << plainText((*uuids)[i]) << '\n';
}

void printReply(const qk::Reply& reply, const Global& options, Output output,
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

std::unique_ptr<qk::Connection> connectOrExplain(const Global& options) {
  std::string error;
  auto connection = qk::Connection::connect(options.socketPath, &error);
  if (!connection) {
    std::cerr << "quarterctl: " << error << '\n';
    return nullptr;
  }
  connection->setReplyTimeout(options.timeout);
  return connection;
}

int finish(const qk::Connection& connection, const std::optional<qk::Reply>& reply, const Global& options,
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

}  // namespace

int deliver(const Global& global, const std::function<qk::Result(qk::Connection&)>& send, Output output,
            const std::vector<std::string>& keys) {
  auto connection = connectOrExplain(global);
  if (!connection) return kExitUsage;
  return finish(*connection, send(*connection), global, output, keys);
}

}  // namespace ctl
