// The property-list value: the one type that carries request messages and
// replies (and, inside the daemon, metadata files, journals and
// entitlements). Value semantics; a dictionary keeps its keys sorted so that
// written files are reproducible.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace quarterkit::plist {

class Value;
using Array = std::vector<Value>;
using Dictionary = std::map<std::string, Value, std::less<>>;
using Data = std::vector<uint8_t>;

// A 64-bit integer that remembers whether it was written as unsigned (values
// above INT64_MAX can only be unsigned).
struct Integer {
  uint64_t bits = 0;
  bool isUnsigned = false;
  int64_t asSigned() const { return static_cast<int64_t>(bits); }
  uint64_t asUnsigned() const { return bits; }
  bool operator==(const Integer& o) const { return bits == o.bits && isUnsigned == o.isUnsigned; }
};

// Seconds since 2001-01-01 00:00:00 UTC.
struct Date {
  double seconds = 0;
  bool operator==(const Date& o) const { return seconds == o.seconds; }
};

enum class Type { Boolean, Integer, Real, Date, String, Data, Array, Dictionary };

class Value {
 public:
  Value() : v_(false) {}
  Value(bool b) : v_(b) {}
  Value(int v) : v_(Integer{static_cast<uint64_t>(static_cast<int64_t>(v)), false}) {}
  Value(long v) : v_(Integer{static_cast<uint64_t>(static_cast<int64_t>(v)), false}) {}
  Value(long long v) : v_(Integer{static_cast<uint64_t>(static_cast<int64_t>(v)), false}) {}
  Value(unsigned v) : v_(Integer{v, false}) {}
  // Unsigned 64-bit values keep their unsignedness only when they need it, as
  // the binary format writes them.
  Value(unsigned long v) : v_(Integer{v, v > INT64_MAX}) {}
  Value(unsigned long long v) : v_(Integer{v, v > INT64_MAX}) {}
  Value(Integer i) : v_(i) {}
  Value(double d) : v_(d) {}
  Value(Date d) : v_(d) {}
  Value(const char* s) : v_(std::string(s)) {}
  Value(std::string s) : v_(std::move(s)) {}
  Value(std::string_view s) : v_(std::string(s)) {}
  Value(Data d) : v_(std::move(d)) {}
  Value(Array a) : v_(std::move(a)) {}
  Value(Dictionary d) : v_(std::move(d)) {}

  Type type() const { return static_cast<Type>(v_.index()); }
  bool isBoolean() const { return type() == Type::Boolean; }
  bool isInteger() const { return type() == Type::Integer; }
  bool isReal() const { return type() == Type::Real; }
  bool isDate() const { return type() == Type::Date; }
  bool isString() const { return type() == Type::String; }
  bool isData() const { return type() == Type::Data; }
  bool isArray() const { return type() == Type::Array; }
  bool isDictionary() const { return type() == Type::Dictionary; }

  // Typed access; the caller checks the type first (a wrong type throws
  // std::bad_variant_access, which the operation guards turn into error 40).
  bool boolean() const { return std::get<bool>(v_); }
  const Integer& integer() const { return std::get<Integer>(v_); }
  double real() const { return std::get<double>(v_); }
  const Date& date() const { return std::get<Date>(v_); }
  const std::string& string() const { return std::get<std::string>(v_); }
  const Data& data() const { return std::get<Data>(v_); }
  const Array& array() const { return std::get<Array>(v_); }
  Array& array() { return std::get<Array>(v_); }
  const Dictionary& dictionary() const { return std::get<Dictionary>(v_); }
  Dictionary& dictionary() { return std::get<Dictionary>(v_); }

  // Lenient readers: the value if it has the type, else nothing.
  const std::string* stringIf() const { return std::get_if<std::string>(&v_); }
  const Dictionary* dictionaryIf() const { return std::get_if<Dictionary>(&v_); }
  const Array* arrayIf() const { return std::get_if<Array>(&v_); }
  const Data* dataIf() const { return std::get_if<Data>(&v_); }
  const Integer* integerIf() const { return std::get_if<Integer>(&v_); }
  const bool* booleanIf() const { return std::get_if<bool>(&v_); }

  bool operator==(const Value& o) const { return v_ == o.v_; }
  bool operator!=(const Value& o) const { return !(*this == o); }

 private:
  std::variant<bool, Integer, double, Date, std::string, Data, Array, Dictionary> v_;
};

// Looks up a key of a dictionary; nullptr when absent.
inline const Value* find(const Dictionary& d, std::string_view key) {
  auto it = d.find(key);
  return it == d.end() ? nullptr : &it->second;
}

// The old-style text form used in log messages: strings as themselves,
// arrays as "( a, b )", dictionaries as "{ key = value; }".
std::string describe(const Value& v);

}  // namespace quarterkit::plist
