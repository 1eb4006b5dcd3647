// The XML property-list reader. Hand-written rather than built on a general XML
// parser so that nothing in the input can reach a DTD, an entity or the network,
// and so that every limit is checked before the work it guards.
#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <exception>
#include <string_view>

#include "base/PlistCodec.h"

namespace quarterkit::plist {
namespace {

bool isSpace(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }
bool isDigit(char c) { return c >= '0' && c <= '9'; }

std::string_view trim(std::string_view s) {
  while (!s.empty() && isSpace(s.front())) s.remove_prefix(1);
  while (!s.empty() && isSpace(s.back())) s.remove_suffix(1);
  return s;
}

int digitValue(char c, unsigned base) {
  int v = -1;
  if (c >= '0' && c <= '9')
    v = c - '0';
  else if (c >= 'a' && c <= 'f')
    v = c - 'a' + 10;
  else if (c >= 'A' && c <= 'F')
    v = c - 'A' + 10;
  return v < static_cast<int>(base) ? v : -1;
}

// Strict UTF-8: no overlong forms, no surrogates, nothing above U+10FFFF. NUL
// is refused too, since strings end up in system calls. Returns the offset of
// the first bad byte, or npos.
size_t findInvalidUTF8(std::string_view s) {
  const auto* p = reinterpret_cast<const unsigned char*>(s.data());
  size_t i = 0, n = s.size();
  while (i < n) {
    unsigned c = p[i];
    if (c >= 0x01 && c < 0x80) {
      ++i;
      continue;
    }
    size_t len;
    unsigned lo = 0x80, hi = 0xBF;  // allowed range of the second byte
    if (c >= 0xC2 && c <= 0xDF)
      len = 2;
    else if (c >= 0xE0 && c <= 0xEF) {
      len = 3;
      if (c == 0xE0) lo = 0xA0;
      if (c == 0xED) hi = 0x9F;
    } else if (c >= 0xF0 && c <= 0xF4) {
      len = 4;
      if (c == 0xF0) lo = 0x90;
      if (c == 0xF4) hi = 0x8F;
    } else
      return i;
    if (n - i < len || p[i + 1] < lo || p[i + 1] > hi) return i;
    for (size_t k = 2; k < len; ++k)
      if ((p[i + k] & 0xC0) != 0x80) return i;
    i += len;
  }
  return std::string_view::npos;
}

void appendUTF8(std::string& out, uint32_t cp) {
  if (cp < 0x80) {
    out += static_cast<char>(cp);
  } else if (cp < 0x800) {
    out += static_cast<char>(0xC0 | (cp >> 6));
    out += static_cast<char>(0x80 | (cp & 0x3F));
  } else if (cp < 0x10000) {
    out += static_cast<char>(0xE0 | (cp >> 12));
    out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (cp & 0x3F));
  } else {
    out += static_cast<char>(0xF0 | (cp >> 18));
    out += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
    out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (cp & 0x3F));
  }
}

// Decimal or 0x hexadecimal with an optional sign; anything from INT64_MIN to
// UINT64_MAX, values above INT64_MAX marked unsigned.
std::optional<Integer> parseInteger(std::string_view s) {
  s = trim(s);
  bool negative = false;
  if (!s.empty() && (s[0] == '+' || s[0] == '-')) {
    negative = s[0] == '-';
    s.remove_prefix(1);
  }
  unsigned base = 10;
  if (s.size() > 2 && s[0] == '0' && (s[1] == 'x' || s[1] == 'X')) {
    base = 16;
    s.remove_prefix(2);
  }
  if (s.empty()) return std::nullopt;
  uint64_t magnitude = 0;
  for (char c : s) {
    int d = digitValue(c, base);
    if (d < 0 || magnitude > (UINT64_MAX - static_cast<uint64_t>(d)) / base) return std::nullopt;
    magnitude = magnitude * base + static_cast<uint64_t>(d);
  }
  if (negative) {
    if (magnitude > static_cast<uint64_t>(INT64_MAX) + 1) return std::nullopt;
    return Integer{0 - magnitude, false};
  }
  return Integer{magnitude, magnitude > static_cast<uint64_t>(INT64_MAX)};
}

std::optional<double> parseReal(std::string_view s) {
  s = trim(s);
  if (s.empty()) return std::nullopt;
  std::string text(s);  // strtod needs the terminator
  char* end = nullptr;
  errno = 0;
  double d = std::strtod(text.c_str(), &end);
  if (end != text.c_str() + text.size()) return std::nullopt;
  return d;
}

int64_t daysFromCivil(int64_t y, unsigned m, unsigned d) {
  y -= m <= 2;
  const int64_t era = (y >= 0 ? y : y - 399) / 400;
  const auto yoe = static_cast<unsigned>(y - era * 400);
  const unsigned doy = (153 * (m > 2 ? m - 3 : m + 9) + 2) / 5 + d - 1;
  const unsigned doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return era * 146097 + static_cast<int64_t>(doe) - 719468;
}

unsigned daysInMonth(int64_t y, unsigned m) {
  static const unsigned kDays[] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  bool leap = (y % 4 == 0 && y % 100 != 0) || y % 400 == 0;
  return m == 2 && leap ? 29 : kDays[m - 1];
}

// "YYYY-MM-DDTHH:MM:SSZ" (the year may be signed and longer, the seconds may
// carry a fraction) as seconds since 2001-01-01 00:00:00 UTC.
std::optional<double> parseDate(std::string_view s) {
  s = trim(s);
  size_t i = 0;
  bool negative = false;
  if (i < s.size() && (s[i] == '-' || s[i] == '+')) negative = s[i++] == '-';
  int64_t year = 0;
  size_t digits = 0;
  for (; i < s.size() && isDigit(s[i]); ++i, ++digits) {
    if (digits == 15) return std::nullopt;  // keeps the day count inside int64
    year = year * 10 + (s[i] - '0');
  }
  if (digits < 4) return std::nullopt;
  if (negative) year = -year;
  unsigned field[5];  // month, day, hour, minute, second
  static const char kSeparators[] = "-T::";
  for (size_t f = 0; f < 5; ++f) {
    const char sep = f == 0 ? '-' : kSeparators[f - 1];
    if (i + 3 > s.size() || s[i] != sep || !isDigit(s[i + 1]) || !isDigit(s[i + 2])) return std::nullopt;
    field[f] = static_cast<unsigned>((s[i + 1] - '0') * 10 + (s[i + 2] - '0'));
    i += 3;
  }
  double fraction = 0;
  if (i < s.size() && s[i] == '.') {
    size_t start = i++;
    while (i < s.size() && isDigit(s[i])) ++i;
    if (i == start + 1) return std::nullopt;
    fraction = std::strtod(std::string(s.substr(start, i - start)).c_str(), nullptr);
  }
  if (i + 1 != s.size() || s[i] != 'Z') return std::nullopt;
  const unsigned month = field[0], day = field[1];
  if (month < 1 || month > 12 || day < 1 || day > daysInMonth(year, month) || field[2] > 23 || field[3] > 59 ||
      field[4] > 59)
    return std::nullopt;
  const int64_t days = daysFromCivil(year, month, day) - daysFromCivil(2001, 1, 1);
  return static_cast<double>(days) * 86400.0 + field[2] * 3600.0 + field[3] * 60.0 + field[4] + fraction;
}

int base64Value(char c) {
  if (c >= 'A' && c <= 'Z') return c - 'A';
  if (c >= 'a' && c <= 'z') return c - 'a' + 26;
  if (c >= '0' && c <= '9') return c - '0' + 52;
  if (c == '+') return 62;
  if (c == '/') return 63;
  return -1;
}

// Whitespace anywhere is ignored; padding is optional but only at the end.
std::optional<Data> parseBase64(std::string_view s) {
  Data out;
  out.reserve(s.size() / 4 * 3 + 3);
  uint32_t acc = 0;
  int bits = 0;
  size_t chars = 0, padding = 0;
  for (char c : s) {
    if (isSpace(c)) continue;
    if (c == '=') {
      ++padding;
      continue;
    }
    int v = base64Value(c);
    if (v < 0 || padding) return std::nullopt;
    acc = (acc << 6) | static_cast<uint32_t>(v);
    bits += 6;
    ++chars;
    if (bits >= 8) {
      bits -= 8;
      out.push_back(static_cast<uint8_t>(acc >> bits));
    }
  }
  if (chars % 4 == 1) return std::nullopt;
  if (padding && (padding > 2 || (chars + padding) % 4 != 0)) return std::nullopt;
  return out;
}

struct Tag {
  std::string_view name;
  bool empty = false;  // <name/>
};

class Reader {
 public:
  explicit Reader(std::string_view in) : in_(in) {}
  std::optional<Value> document();
  const std::string& error() const { return error_; }

 private:
  bool fail(const std::string& reason);
  bool at(std::string_view s) const { return in_.substr(pos_).starts_with(s); }
  bool skipPast(std::string_view terminator, const char* what);
  bool skipCommentOrPI(bool* skipped);
  bool skipMisc();
  bool doctype();
  bool markupDeclaration();
  bool startTag(Tag& tag);
  bool endTag(std::string_view name);
  bool text(std::string_view name, std::string& out);
  bool reference(std::string& out);
  bool countObject();
  bool value(Value& out, size_t depth);
  bool scalar(const Tag& tag, Value& out);
  bool array(const Tag& tag, Value& out, size_t depth);
  bool dictionary(const Tag& tag, Value& out, size_t depth);

  std::string_view in_;
  size_t pos_ = 0;
  size_t objects_ = 0;
  std::string error_;
};

bool Reader::fail(const std::string& reason) {
  if (error_.empty()) error_ = reason + " at byte " + std::to_string(pos_);
  return false;
}

bool Reader::skipPast(std::string_view terminator, const char* what) {
  size_t end = in_.find(terminator, pos_);
  if (end == std::string_view::npos) return fail(std::string("unterminated ") + what);
  pos_ = end + terminator.size();
  return true;
}

// Skips one comment or processing instruction, if one starts here.
bool Reader::skipCommentOrPI(bool* skipped) {
  *skipped = true;
  if (at("<!--")) {
    pos_ += 4;
    return skipPast("-->", "comment");
  }
  if (at("<?")) {
    pos_ += 2;
    return skipPast("?>", "processing instruction");
  }
  *skipped = false;
  return true;
}

// Whitespace, comments and processing instructions (the XML declaration among them).
bool Reader::skipMisc() {
  for (;;) {
    while (pos_ < in_.size() && isSpace(in_[pos_])) ++pos_;
    bool skipped;
    if (!skipCommentOrPI(&skipped)) return false;
    if (!skipped) return true;
  }
}

// The document type is skipped, never loaded; anything that could declare an
// entity (an internal subset) is refused.
bool Reader::doctype() {
  pos_ += 9;  // "<!DOCTYPE"
  size_t nameStart = pos_;
  while (pos_ < in_.size() && isSpace(in_[pos_])) ++pos_;
  if (pos_ == nameStart || !at("plist") || pos_ + 5 >= in_.size() || !(isSpace(in_[pos_ + 5]) || in_[pos_ + 5] == '>'))
    return fail("document type is not plist");
  char quote = 0;
  for (; pos_ < in_.size(); ++pos_) {
    char c = in_[pos_];
    if (quote) {
      if (c == quote) quote = 0;
    } else if (c == '"' || c == '\'') {
      quote = c;
    } else if (c == '[') {
      return fail("DTD internal subset refused");
    } else if (c == '>') {
      ++pos_;
      return true;
    }
  }
  return fail("unterminated DOCTYPE");
}

bool Reader::markupDeclaration() {
  if (at("<!ENTITY")) return fail("entity declarations refused");
  if (at("<!DOCTYPE")) return fail("misplaced DOCTYPE");
  return fail("markup declaration refused");
}

bool Reader::startTag(Tag& tag) {
  if (pos_ >= in_.size()) return fail("unexpected end of document");
  if (in_[pos_] != '<') return fail("unexpected text");
  if (at("<!")) return markupDeclaration();
  if (at("</")) return fail("unexpected end tag");
  size_t start = ++pos_;
  auto isNameChar = [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || isDigit(c) || c == '_' || c == ':' || c == '.' ||
           c == '-' || static_cast<unsigned char>(c) >= 0x80;
  };
  while (pos_ < in_.size() && isNameChar(in_[pos_])) ++pos_;
  tag.name = in_.substr(start, pos_ - start);
  if (tag.name.empty()) return fail("malformed tag");
  // Attributes are read for well-formedness and otherwise ignored.
  for (;;) {
    while (pos_ < in_.size() && isSpace(in_[pos_])) ++pos_;
    if (at("/>")) {
      pos_ += 2;
      tag.empty = true;
      return true;
    }
    if (at(">")) {
      ++pos_;
      tag.empty = false;
      return true;
    }
    size_t nameStart = pos_;
    while (pos_ < in_.size() && isNameChar(in_[pos_])) ++pos_;
    if (pos_ == nameStart || !at("=")) return fail("malformed attribute");
    ++pos_;
    if (pos_ >= in_.size() || (in_[pos_] != '"' && in_[pos_] != '\'')) return fail("malformed attribute");
    size_t end = in_.find(in_[pos_], pos_ + 1);
    if (end == std::string_view::npos || in_.substr(pos_, end - pos_).find('<') != std::string_view::npos)
      return fail("malformed attribute");
    pos_ = end + 1;
  }
}

bool Reader::endTag(std::string_view name) {
  if (!at("</")) return fail("expected </" + std::string(name) + ">");
  size_t start = pos_ + 2;
  if (in_.substr(start).starts_with(name)) {
    size_t p = start + name.size();
    while (p < in_.size() && isSpace(in_[p])) ++p;
    if (p < in_.size() && in_[p] == '>') {
      pos_ = p + 1;
      return true;
    }
  }
  return fail("mismatched end tag, expected </" + std::string(name) + ">");
}

// Character data up to </name>, with references and CDATA sections decoded.
bool Reader::text(std::string_view name, std::string& out) {
  for (;;) {
    if (pos_ >= in_.size()) return fail("unclosed <" + std::string(name) + ">");
    if (at("</")) return endTag(name);
    if (at("<![CDATA[")) {
      size_t start = pos_ + 9;
      pos_ = start;
      if (!skipPast("]]>", "CDATA section")) return false;
      out.append(in_.substr(start, pos_ - 3 - start));
    } else if (at("<!--") || at("<?")) {
      bool skipped;
      if (!skipCommentOrPI(&skipped)) return false;
    } else if (at("<")) {
      return fail("unexpected element inside <" + std::string(name) + ">");
    } else if (at("&")) {
      if (!reference(out)) return false;
    } else {
      size_t end = std::min(in_.find_first_of("<&", pos_), in_.size());
      out.append(in_.substr(pos_, end - pos_));
      pos_ = end;
    }
  }
}

bool Reader::reference(std::string& out) {
  size_t end = in_.substr(pos_, 12).find(';');
  if (end == std::string_view::npos) return fail("malformed reference");
  end += pos_;
  std::string_view ref = in_.substr(pos_ + 1, end - pos_ - 1);
  static const std::pair<std::string_view, char> kPredefined[] = {
      {"lt", '<'}, {"gt", '>'}, {"amp", '&'}, {"quot", '"'}, {"apos", '\''}};
  for (const auto& [entity, c] : kPredefined) {
    if (ref == entity) {
      out += c;
      pos_ = end + 1;
      return true;
    }
  }
  if (!ref.starts_with("#")) return fail("undefined entity &" + std::string(ref) + ";");
  ref.remove_prefix(1);
  unsigned base = 10;
  if (ref.starts_with("x")) {
    base = 16;
    ref.remove_prefix(1);
  }
  uint32_t cp = 0;
  for (char c : ref) {
    int d = digitValue(c, base);
    if (d < 0 || cp > 0x10FFFF) return fail("malformed character reference");
    cp = cp * base + static_cast<uint32_t>(d);
  }
  if (ref.empty() || cp == 0 || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF))
    return fail("invalid character reference");
  appendUTF8(out, cp);
  pos_ = end + 1;
  return true;
}

bool Reader::countObject() {
  if (++objects_ > kMaxObjects) return fail("too many objects");
  return true;
}

bool Reader::value(Value& out, size_t depth) {
  Tag tag;
  if (!countObject() || !startTag(tag)) return false;
  if (tag.name == "array") return array(tag, out, depth + 1);
  if (tag.name == "dict") return dictionary(tag, out, depth + 1);
  return scalar(tag, out);
}

bool Reader::scalar(const Tag& tag, Value& out) {
  const std::string_view name = tag.name;
  std::string content;
  const bool known = name == "string" || name == "integer" || name == "real" || name == "date" || name == "data" ||
                     name == "true" || name == "false";
  if (!known) {
    if (name == "key") return fail("<key> outside <dict>");
    return fail("unknown element <" + std::string(name) + ">");
  }
  if (!tag.empty && !text(name, content)) return false;
  if (name == "string") {
    out = Value(std::move(content));
  } else if (name == "true" || name == "false") {
    if (!trim(content).empty()) return fail("<" + std::string(name) + "> must be empty");
    out = Value(name == "true");
  } else if (name == "integer") {
    auto v = parseInteger(content);
    if (!v) return fail("invalid <integer>");
    out = Value(*v);
  } else if (name == "real") {
    auto v = parseReal(content);
    if (!v) return fail("invalid <real>");
    out = Value(*v);
  } else if (name == "date") {
    auto v = parseDate(content);
    if (!v) return fail("invalid <date>");
    out = Value(Date{*v});
  } else {
    auto v = parseBase64(content);
    if (!v) return fail("invalid base64 in <data>");
    out = Value(std::move(*v));
  }
  return true;
}

bool Reader::array(const Tag& tag, Value& out, size_t depth) {
  if (depth > kMaxDepth) return fail("nesting deeper than " + std::to_string(kMaxDepth));
  Array items;
  while (!tag.empty) {
    if (!skipMisc()) return false;
    if (pos_ >= in_.size()) return fail("unclosed <array>");
    if (at("</")) {
      if (!endTag("array")) return false;
      break;
    }
    items.emplace_back();
    if (!value(items.back(), depth)) return false;
  }
  out = Value(std::move(items));
  return true;
}

bool Reader::dictionary(const Tag& tag, Value& out, size_t depth) {
  if (depth > kMaxDepth) return fail("nesting deeper than " + std::to_string(kMaxDepth));
  Dictionary entries;
  while (!tag.empty) {
    if (!skipMisc()) return false;
    if (pos_ >= in_.size()) return fail("unclosed <dict>");
    if (at("</")) {
      if (!endTag("dict")) return false;
      break;
    }
    Tag keyTag;
    if (!countObject() || !startTag(keyTag)) return false;
    if (keyTag.name != "key") return fail("expected <key> in <dict>");
    std::string key;
    if (!keyTag.empty && !text("key", key)) return false;
    auto [it, inserted] = entries.try_emplace(std::move(key));
    if (!inserted) return fail("duplicate key \"" + it->first + "\"");
    if (!skipMisc()) return false;
    if (at("</")) return fail("key without a value");
    if (!value(it->second, depth)) return false;
  }
  out = Value(std::move(entries));
  return true;
}

std::optional<Value> Reader::document() {
  size_t bad = findInvalidUTF8(in_);
  if (bad != std::string_view::npos) {
    pos_ = bad;
    fail("invalid UTF-8");
    return std::nullopt;
  }
  if (at("\xEF\xBB\xBF")) pos_ = 3;
  if (!skipMisc()) return std::nullopt;
  if (at("<!DOCTYPE") && (!doctype() || !skipMisc())) return std::nullopt;
  Tag root;
  if (!startTag(root)) return std::nullopt;
  if (root.name != "plist" || root.empty) {
    fail("root element is not a <plist> with a value");
    return std::nullopt;
  }
  Value result;
  if (!skipMisc()) return std::nullopt;
  if (at("</")) {
    fail("empty <plist>");
    return std::nullopt;
  }
  if (!value(result, 0) || !skipMisc()) return std::nullopt;
  if (!at("</")) {
    fail("more than one value in <plist>");
    return std::nullopt;
  }
  if (!endTag("plist") || !skipMisc()) return std::nullopt;
  if (pos_ != in_.size()) {
    fail("content after </plist>");
    return std::nullopt;
  }
  return result;
}

}  // namespace

std::optional<Value> parseXML(const void* bytes, size_t length, std::string* error) {
  try {
    if (!bytes && length) {
      if (error) *error = "no data";
      return std::nullopt;
    }
    Reader reader(std::string_view(static_cast<const char*>(bytes), length));
    auto result = reader.document();
    if (!result && error) *error = reader.error();
    return result;
  } catch (const std::exception& e) {
    if (error) *error = std::string("XML property list: ") + e.what();
    return std::nullopt;
  }
}

}  // namespace quarterkit::plist
