// Binary property lists from clients and container files: whatever the reader
// accepts must survive our writer and reader unchanged.
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "base/PlistCodec.h"

namespace {

// Value equality, except that a NaN equals a NaN (the writer keeps its bits,
// but a float NaN widened to double need not compare equal to anything).
bool sameReal(double a, double b) { return (std::isnan(a) && std::isnan(b)) || a == b; }

bool same(const plist::Value& a, const plist::Value& b) {
  if (a.type() != b.type()) return false;
  switch (a.type()) {
    case plist::Type::Real: return sameReal(a.real(), b.real());
    case plist::Type::Date: return sameReal(a.date().seconds, b.date().seconds);
    case plist::Type::Array: {
      const plist::Array& x = a.array();
      const plist::Array& y = b.array();
      if (x.size() != y.size()) return false;
      for (size_t i = 0; i < x.size(); ++i) {
        if (!same(x[i], y[i])) return false;
      }
      return true;
    }
    case plist::Type::Dictionary: {
      const plist::Dictionary& x = a.dictionary();
      const plist::Dictionary& y = b.dictionary();
      if (x.size() != y.size()) return false;
      for (auto i = x.begin(), j = y.begin(); i != x.end(); ++i, ++j) {
        if (i->first != j->first || !same(i->second, j->second)) return false;
      }
      return true;
    }
    default: return a == b;
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  auto value = plist::parseBinary(data, size);
  if (!value) return 0;
  plist::Data written = plist::writeBinary(*value);
  auto again = plist::parseBinary(written.data(), written.size());
  if (!again || !same(*value, *again)) abort();
  if (plist::writeBinary(*again) != written) abort();
  (void)plist::describe(*value);
  return 0;
}
