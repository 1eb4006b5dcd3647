// printf-style message formatting with "%@" for an object's description, as
// every log line and error description of the daemon is written.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>

#include "base/PlistValue.h"

// One argument of a message. Integers, doubles, C strings and pointers format
// as printf would; an object formats through %@ as its description (and
// through %s as the same text).
struct QRTFormatArg {
  enum class Kind { Signed, Unsigned, Double, CString, Object, Pointer };
  Kind kind;
  int64_t i = 0;
  uint64_t u = 0;
  double d = 0;
  const char* s = nullptr;  // nullptr prints "(null)"
  std::string object;       // description of an object argument
  const void* p = nullptr;

  QRTFormatArg(bool v) : kind(Kind::Signed), i(v) {}
  QRTFormatArg(char v) : kind(Kind::Signed), i(v) {}
  QRTFormatArg(signed char v) : kind(Kind::Signed), i(v) {}
  QRTFormatArg(short v) : kind(Kind::Signed), i(v) {}
  QRTFormatArg(int v) : kind(Kind::Signed), i(v) {}
  QRTFormatArg(long v) : kind(Kind::Signed), i(v) {}
  QRTFormatArg(long long v) : kind(Kind::Signed), i(v) {}
  QRTFormatArg(unsigned char v) : kind(Kind::Unsigned), u(v) {}
  QRTFormatArg(unsigned short v) : kind(Kind::Unsigned), u(v) {}
  QRTFormatArg(unsigned v) : kind(Kind::Unsigned), u(v) {}
  QRTFormatArg(unsigned long v) : kind(Kind::Unsigned), u(v) {}
  QRTFormatArg(unsigned long long v) : kind(Kind::Unsigned), u(v) {}
  QRTFormatArg(double v) : kind(Kind::Double), d(v) {}
  QRTFormatArg(const char* v) : kind(Kind::CString), s(v) {}
  QRTFormatArg(char* v) : kind(Kind::CString), s(v) {}
  QRTFormatArg(const void* v) : kind(Kind::Pointer), p(v) {}
  QRTFormatArg(std::nullptr_t) : kind(Kind::Object), object("(null)") {}
  QRTFormatArg(const std::string& v) : kind(Kind::Object), object(v) {}
  QRTFormatArg(std::string_view v) : kind(Kind::Object), object(v) {}
  QRTFormatArg(const plist::Value& v) : kind(Kind::Object), object(plist::describe(v)) {}
  // Anything with a description() member, and optionals and shared pointers of
  // such things (absent prints "(null)").
  template <typename T, typename = decltype(std::declval<const T&>().description())>
  QRTFormatArg(const T& v) : kind(Kind::Object), object(v.description()) {}
  template <typename T>
  QRTFormatArg(const std::optional<T>& v) : QRTFormatArg(v ? QRTFormatArg(*v) : QRTFormatArg(nullptr)) {}
  template <typename T>
  QRTFormatArg(const std::shared_ptr<T>& v) : QRTFormatArg(v ? QRTFormatArg(*v) : QRTFormatArg(nullptr)) {}
};

// Formats with printf conversions (flags, width, precision and length
// modifiers of %d %i %u %x %X %o %c %s %p %f %g %e %zu %%) and %@. A
// conversion whose argument is missing or of another kind prints its best
// reading of the argument; nothing here can crash on a bad format.
std::string QRTFormatArgs(const char* format, std::initializer_list<QRTFormatArg> args);

template <typename... Args>
std::string QRTFormat(const char* format, const Args&... args) {
  return QRTFormatArgs(format, {QRTFormatArg(args)...});
}

// An errno value as every log line and error description gives it.
const char* errorText(int err);
