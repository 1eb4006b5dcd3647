#include "base/PlistValue.h"

#include <charconv>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstring>

namespace quarterkit::plist {
namespace {

bool isPlainToken(std::string_view s) {
  if (s.empty()) return false;
  for (unsigned char c : s) {
    bool alnum = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
    if (!alnum && std::strchr("_$+/:.-", c) == nullptr) return false;
  }
  return true;
}

const char* escapeFor(unsigned char c) {
  switch (c) {
    case '"': return "\\\"";
    case '\\': return "\\\\";
    case '\a': return "\\a";
    case '\b': return "\\b";
    case '\f': return "\\f";
    case '\n': return "\\n";
    case '\r': return "\\r";
    case '\t': return "\\t";
    case '\v': return "\\v";
    default: return nullptr;
  }
}

// Bytes of 0x80 and above pass through: they are UTF-8 and read better as is.
void appendQuoted(std::string& out, std::string_view s) {
  out += '"';
  for (unsigned char c : s) {
    if (const char* escape = escapeFor(c)) {
      out += escape;
    } else if (c < 0x20 || c == 0x7f) {
      char buf[8];
      std::snprintf(buf, sizeof buf, "\\%03o", c);
      out += buf;
    } else {
      out += static_cast<char>(c);
    }
  }
  out += '"';
}

void appendReal(std::string& out, double d) {
  char buf[64];
  auto result = std::to_chars(buf, buf + sizeof buf, d);
  out.append(buf, result.ptr);
}

void appendInteger(std::string& out, const Integer& i) {
  char buf[32];
  auto result = i.isUnsigned ? std::to_chars(buf, buf + sizeof buf, i.asUnsigned())
                             : std::to_chars(buf, buf + sizeof buf, i.asSigned());
  out.append(buf, result.ptr);
}

// Days since 1970-01-01 to a proleptic Gregorian date.
void civilFromDays(int64_t z, int64_t& year, unsigned& month, unsigned& day) {
  z += 719468;
  const int64_t era = (z >= 0 ? z : z - 146096) / 146097;
  const int64_t doe = z - era * 146097;
  const int64_t yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
  const int64_t doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
  const int64_t mp = (5 * doy + 2) / 153;
  day = static_cast<unsigned>(doy - (153 * mp + 2) / 5 + 1);
  month = static_cast<unsigned>(mp < 10 ? mp + 3 : mp - 9);
  year = yoe + era * 400 + (month <= 2 ? 1 : 0);
}

void appendDate(std::string& out, const Date& date) {
  // Dates have no range limit; beyond some ten million years a calendar form
  // is meaningless, so those (and NaN) show the raw seconds.
  constexpr double kCalendarLimit = 1e15;
  if (!std::isfinite(date.seconds) || std::fabs(date.seconds) > kCalendarLimit) {
    appendReal(out, date.seconds);
    return;
  }
  constexpr int64_t kUnixToReference = 978307200;
  const int64_t total = static_cast<int64_t>(std::floor(date.seconds)) + kUnixToReference;
  int64_t days = total / 86400;
  int64_t secs = total % 86400;
  if (secs < 0) {
    secs += 86400;
    --days;
  }
  int64_t year;
  unsigned month, day;
  civilFromDays(days, year, month, day);
  char buf[96];
  std::snprintf(buf, sizeof buf, "%04" PRId64 "-%02u-%02u %02d:%02d:%02d +0000", year, month, day,
                static_cast<int>(secs / 3600), static_cast<int>(secs / 60 % 60), static_cast<int>(secs % 60));
  out += buf;
}

void appendData(std::string& out, const Data& data) {
  static const char kHex[] = "0123456789abcdef";
  out += '<';
  for (size_t i = 0; i < data.size(); ++i) {
    if (i != 0 && i % 4 == 0) out += ' ';
    out += kHex[data[i] >> 4];
    out += kHex[data[i] & 0xf];
  }
  out += '>';
}

void appendValue(std::string& out, const Value& v, bool nested);

void appendString(std::string& out, const std::string& s, bool nested) {
  if (!nested || isPlainToken(s)) {
    out += s;
  } else {
    appendQuoted(out, s);
  }
}

void appendArray(std::string& out, const Array& array) {
  if (array.empty()) {
    out += "( )";
    return;
  }
  out += "( ";
  for (size_t i = 0; i < array.size(); ++i) {
    if (i != 0) out += ", ";
    appendValue(out, array[i], true);
  }
  out += " )";
}

void appendDictionary(std::string& out, const Dictionary& dictionary) {
  out += '{';
  for (const auto& [key, value] : dictionary) {
    out += ' ';
    appendString(out, key, true);
    out += " = ";
    appendValue(out, value, true);
    out += ';';
  }
  out += " }";
}

void appendValue(std::string& out, const Value& v, bool nested) {
  switch (v.type()) {
    case Type::Boolean: out += v.boolean() ? '1' : '0'; break;
    case Type::Integer: appendInteger(out, v.integer()); break;
    case Type::Real: appendReal(out, v.real()); break;
    case Type::Date: appendDate(out, v.date()); break;
    case Type::String: appendString(out, v.string(), nested); break;
    case Type::Data: appendData(out, v.data()); break;
    case Type::Array: appendArray(out, v.array()); break;
    case Type::Dictionary: appendDictionary(out, v.dictionary()); break;
  }
}

}  // namespace

std::string describe(const Value& v) {
  if (const std::string* s = v.stringIf()) return *s;
  std::string out;
  appendValue(out, v, false);
  return out;
}

}  // namespace quarterkit::plist
