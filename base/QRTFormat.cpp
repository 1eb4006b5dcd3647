// Each conversion is handed to snprintf as one sanitised directive together with a
// value of the exact C type that directive names, so no format string can make us
// read a missing argument or one of the wrong type.
#include "base/QRTFormat.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstring>

namespace {

using Arg = QRTFormatArg;
using Kind = QRTFormatArg::Kind;

// Bounds width and precision so that a hostile format cannot ask for a huge output.
constexpr int kMaxField = 4096;

enum class Length { None, Char, Short, Long, LongDouble };

struct Directive {
  std::string flags;
  int width = -1;
  int precision = -1;
  Length length = Length::None;
  char conversion = 0;
  bool has(char flag) const { return flags.find(flag) != std::string::npos; }
};

class ArgCursor {
 public:
  explicit ArgCursor(std::initializer_list<Arg> args) : args_(args) {}
  const Arg* take() { return next_ < args_.size() ? args_.begin() + next_++ : nullptr; }

 private:
  std::initializer_list<Arg> args_;
  size_t next_ = 0;
};

// Float-to-integer casts are undefined outside the target range; saturate instead.
int64_t saturateSigned(double d) {
  if (std::isnan(d)) return 0;
  if (d >= 9223372036854775808.0) return INT64_MAX;
  if (d <= -9223372036854775808.0) return INT64_MIN;
  return static_cast<int64_t>(d);
}

uint64_t saturateUnsigned(double d) {
  if (d < 0) return static_cast<uint64_t>(saturateSigned(d));
  if (std::isnan(d)) return 0;
  if (d >= 18446744073709551616.0) return UINT64_MAX;
  return static_cast<uint64_t>(d);
}

uint64_t pointerBits(const void* p) { return static_cast<uint64_t>(reinterpret_cast<uintptr_t>(p)); }

int64_t signedOf(const Arg& a) {
  switch (a.kind) {
    case Kind::Signed: return a.i;
    case Kind::Unsigned: return static_cast<int64_t>(a.u);
    case Kind::Double: return saturateSigned(a.d);
    case Kind::Pointer: return static_cast<int64_t>(pointerBits(a.p));
    default: return 0;
  }
}

uint64_t unsignedOf(const Arg& a) {
  switch (a.kind) {
    case Kind::Signed: return static_cast<uint64_t>(a.i);
    case Kind::Unsigned: return a.u;
    case Kind::Double: return saturateUnsigned(a.d);
    case Kind::Pointer: return pointerBits(a.p);
    default: return 0;
  }
}

double doubleOf(const Arg& a) {
  switch (a.kind) {
    case Kind::Signed: return static_cast<double>(a.i);
    case Kind::Unsigned: return static_cast<double>(a.u);
    case Kind::Double: return a.d;
    case Kind::Pointer: return static_cast<double>(pointerBits(a.p));
    default: return 0;
  }
}

// The value a conversion of the given size sees, as printf would after the
// default argument promotions.
int64_t narrowSigned(int64_t v, Length length) {
  switch (length) {
    case Length::Char: return static_cast<signed char>(v);
    case Length::Short: return static_cast<short>(v);
    case Length::None: return static_cast<int>(v);
    default: return v;
  }
}

uint64_t narrowUnsigned(uint64_t v, Length length) {
  switch (length) {
    case Length::Char: return static_cast<unsigned char>(v);
    case Length::Short: return static_cast<unsigned short>(v);
    case Length::None: return static_cast<unsigned>(v);
    default: return v;
  }
}

// Text an argument carries itself (an object's description or a C string).
std::optional<std::string_view> ownText(const Arg* a) {
  if (!a) return std::nullopt;
  if (a->kind == Kind::Object) return a->object;
  if (a->kind == Kind::CString) return a->s ? a->s : "(null)";
  return std::nullopt;
}

std::string hexPointer(uint64_t bits) {
  char buf[24];
  std::snprintf(buf, sizeof buf, "0x%llx", static_cast<unsigned long long>(bits));
  return buf;
}

// What %@ prints for an argument: numbers in decimal (reals in their shortest
// exact form), strings and objects as their text.
std::string naturalText(const Arg* a) {
  if (!a) return "(null)";
  switch (a->kind) {
    case Kind::Object: return a->object;
    case Kind::CString: return a->s ? a->s : "(null)";
    case Kind::Signed: return std::to_string(a->i);
    case Kind::Unsigned: return std::to_string(a->u);
    case Kind::Pointer: return hexPointer(pointerBits(a->p));
    case Kind::Double: {
      char buf[64];
      auto result = std::to_chars(buf, buf + sizeof buf, a->d);
      return std::string(buf, result.ptr);
    }
  }
  return {};
}

void appendPadded(std::string& out, std::string_view text, const Directive& directive, bool usePrecision) {
  if (usePrecision && directive.precision >= 0 && text.size() > static_cast<size_t>(directive.precision))
    text = text.substr(0, static_cast<size_t>(directive.precision));
  size_t fill =
      directive.width > 0 && static_cast<size_t>(directive.width) > text.size() ? directive.width - text.size() : 0;
  if (!directive.has('-')) out.append(fill, ' ');
  out.append(text);
  if (directive.has('-')) out.append(fill, ' ');
}

// "%" + the flags the conversion allows + width and precision + length + conversion.
std::string printfSpec(const Directive& directive, const char* allowedFlags, const char* length) {
  std::string fmt = "%";
  for (char flag : directive.flags)
    if (std::strchr(allowedFlags, flag)) fmt += flag;
  if (directive.width >= 0) fmt += std::to_string(directive.width);
  if (directive.precision >= 0) fmt += "." + std::to_string(directive.precision);
  fmt += length;
  fmt += directive.conversion;
  return fmt;
}

template <typename T>
void appendPrintf(std::string& out, const std::string& fmt, T value) {
  char buf[128];
  int n = std::snprintf(buf, sizeof buf, fmt.c_str(), value);
  if (n < 0) return;
  if (static_cast<size_t>(n) < sizeof buf) {
    out.append(buf, static_cast<size_t>(n));
    return;
  }
  size_t old = out.size();
  out.resize(old + static_cast<size_t>(n) + 1);
  std::snprintf(out.data() + old, static_cast<size_t>(n) + 1, fmt.c_str(), value);
  out.resize(old + static_cast<size_t>(n));
}

void appendInteger(std::string& out, const Directive& directive, const Arg* arg) {
  if (auto text = ownText(arg)) return appendPadded(out, *text, directive, false);
  const bool isSigned = directive.conversion == 'd' || directive.conversion == 'i';
  if (isSigned) {
    int64_t v = arg ? narrowSigned(signedOf(*arg), directive.length) : 0;
    appendPrintf(out, printfSpec(directive, "-+ 0", "ll"), static_cast<long long>(v));
  } else {
    uint64_t v = arg ? narrowUnsigned(unsignedOf(*arg), directive.length) : 0;
    appendPrintf(out, printfSpec(directive, "-#0", "ll"), static_cast<unsigned long long>(v));
  }
}

void appendReal(std::string& out, const Directive& directive, const Arg* arg) {
  if (auto text = ownText(arg)) return appendPadded(out, *text, directive, false);
  double v = arg ? doubleOf(*arg) : 0;
  if (directive.length == Length::LongDouble)
    appendPrintf(out, printfSpec(directive, "-+ #0", "L"), static_cast<long double>(v));
  else
    appendPrintf(out, printfSpec(directive, "-+ #0", ""), v);
}

void appendChar(std::string& out, const Directive& directive, const Arg* arg) {
  if (auto text = ownText(arg)) return appendPadded(out, *text, directive, false);
  std::string c = arg ? std::string(1, static_cast<char>(unsignedOf(*arg))) : std::string();
  appendPadded(out, c, directive, false);
}

void appendPointer(std::string& out, const Directive& directive, const Arg* arg) {
  if (auto text = ownText(arg)) return appendPadded(out, *text, directive, false);
  appendPadded(out, hexPointer(arg ? unsignedOf(*arg) : 0), directive, false);
}

// Appends one conversion; false for a conversion we do not know (%n among them).
bool appendConversion(std::string& out, const Directive& directive, ArgCursor& args) {
  switch (directive.conversion) {
    case '%': out += '%'; return true;
    case 'd':
    case 'i':
    case 'u':
    case 'x':
    case 'X':
    case 'o': appendInteger(out, directive, args.take()); return true;
    case 'f':
    case 'F':
    case 'e':
    case 'E':
    case 'g':
    case 'G':
    case 'a':
    case 'A': appendReal(out, directive, args.take()); return true;
    case 's':
    case '@': appendPadded(out, naturalText(args.take()), directive, true); return true;
    case 'c': appendChar(out, directive, args.take()); return true;
    case 'p': appendPointer(out, directive, args.take()); return true;
    default: return false;
  }
}

const char* readNumber(const char* p, int* out) {
  if (*p < '0' || *p > '9') return p;
  int v = 0;
  for (; *p >= '0' && *p <= '9'; ++p) v = std::min(v * 10 + (*p - '0'), kMaxField);
  *out = v;
  return p;
}

// A `*` takes an int argument; a missing one reads as 0.
int starValue(ArgCursor& args) {
  const Arg* arg = args.take();
  int64_t v = arg ? signedOf(*arg) : 0;
  return static_cast<int>(std::clamp<int64_t>(v, -kMaxField, kMaxField));
}

const char* readLength(const char* p, Length* length) {
  if (p[0] == 'h') {
    *length = p[1] == 'h' ? Length::Char : Length::Short;
    return p + (p[1] == 'h' ? 2 : 1);
  }
  if (p[0] == 'l') {
    *length = Length::Long;
    return p + (p[1] == 'l' ? 2 : 1);
  }
  if (p[0] && std::strchr("qzjt", p[0])) {
    *length = Length::Long;
    return p + 1;
  }
  if (p[0] == 'L') {
    *length = Length::LongDouble;
    return p + 1;
  }
  return p;
}

// Reads flags, width, precision and length after a '%'; returns where the
// conversion character is (possibly the terminator).
const char* parseSpec(const char* p, Directive& directive, ArgCursor& args) {
  for (; *p && std::strchr("-+ #0", *p); ++p)
    if (!directive.has(*p)) directive.flags += *p;
  if (*p == '*') {
    ++p;
    int w = starValue(args);
    if (w < 0 && !directive.has('-')) directive.flags += '-';
    directive.width = std::abs(w);
  } else {
    p = readNumber(p, &directive.width);
  }
  if (*p == '.') {
    ++p;
    if (*p == '*') {
      ++p;
      int v = starValue(args);
      directive.precision = v < 0 ? -1 : v;
    } else {
      directive.precision = 0;
      p = readNumber(p, &directive.precision);
    }
  }
  return readLength(p, &directive.length);
}

}  // namespace

std::string QRTFormatArgs(const char* format, std::initializer_list<QRTFormatArg> args) {
  std::string out;
  if (!format) return out;
  ArgCursor cursor(args);
  const char* p = format;
  try {
    while (*p) {
      if (*p != '%') {
        const char* next = std::strchr(p, '%');
        size_t n = next ? static_cast<size_t>(next - p) : std::strlen(p);
        out.append(p, n);
        p += n;
        continue;
      }
      Directive directive;
      const char* conversion = parseSpec(p + 1, directive, cursor);
      if (!*conversion) {  // the format ends inside a conversion: keep it as text
        out.append(p);
        break;
      }
      directive.conversion = *conversion;
      if (!appendConversion(out, directive, cursor)) out.append(p, static_cast<size_t>(conversion + 1 - p));
      p = conversion + 1;
    }
  } catch (const std::exception&) {
    // Out of memory: a log line cut short is better than an exception in the caller.
  }
  return out;
}

const char* errorText(int err) { return strerror(err); }
