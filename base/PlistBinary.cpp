#include <algorithm>
#include <cstring>
#include <iterator>
#include <tuple>
#include <string_view>
#include <unordered_map>

#include "base/PlistCodec.h"

namespace quarterkit::plist {
namespace {

constexpr size_t kHeaderSize = 8;
constexpr size_t kTrailerSize = 32;
// What one object costs in memory once built, besides its payload: the value
// itself and its share of a container (a dictionary entry holds two).
constexpr uint64_t kObjectFootprint = 64;
static_assert(sizeof(Value) <= kObjectFootprint);

uint64_t readBE(const uint8_t* p, size_t width) {
  uint64_t v = 0;
  for (size_t i = 0; i < width; ++i) v = (v << 8) | p[i];
  return v;
}

uint64_t saturatingAdd(uint64_t a, uint64_t b) { return a > UINT64_MAX - b ? UINT64_MAX : a + b; }

double doubleFromBits(uint64_t bits) {
  double d;
  std::memcpy(&d, &bits, sizeof d);
  return d;
}

double floatFromBits(uint32_t bits) {
  float f;
  std::memcpy(&f, &bits, sizeof f);
  return f;
}

bool isHighSurrogate(uint32_t u) { return u >= 0xD800 && u <= 0xDBFF; }
bool isLowSurrogate(uint32_t u) { return u >= 0xDC00 && u <= 0xDFFF; }

void appendUTF8(std::string& out, uint32_t c) {
  if (c < 0x80) {
    out += static_cast<char>(c);
  } else if (c < 0x800) {
    out += static_cast<char>(0xC0 | (c >> 6));
    out += static_cast<char>(0x80 | (c & 0x3F));
  } else if (c < 0x10000) {
    out += static_cast<char>(0xE0 | (c >> 12));
    out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (c & 0x3F));
  } else {
    out += static_cast<char>(0xF0 | (c >> 18));
    out += static_cast<char>(0x80 | ((c >> 12) & 0x3F));
    out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (c & 0x3F));
  }
}

enum class Kind : uint8_t { Boolean, Integer, Real, Date, Data, Ascii, Utf16, Array, Dictionary };

// One object as located in the buffer. `count` is the payload length in the
// kind's units: bytes for numbers and data, characters for strings, entries
// for containers.
struct Object {
  Kind kind;
  bool flag;  // boolean value
  size_t start;
  uint64_t count;
};

// Reads a "bplist00" buffer in two passes. The first visits the object graph
// once per distinct object, validates every object and computes what the
// value would expand to (objects, bytes, depth) without building anything;
// the second builds the value only when those bounds hold.
class BinaryReader {
 public:
  BinaryReader(const uint8_t* bytes, size_t length, const Limits& limits) : p_(bytes), n_(length), limits_(limits) {}

  std::optional<Value> read(std::string* error, uint64_t* footprint) {
    std::optional<Value> result;
    Value top;
    if (readTrailer() && measureTop() && build(top_, top)) result = std::move(top);
    if (!result && error) *error = why_;
    if (result && footprint) *footprint = meta_[top_].count * kObjectFootprint + meta_[top_].bytes;
    return result;
  }

 private:
  enum State : uint8_t { kUnvisited, kActive, kDone };
  struct Meta {
    uint64_t bytes = 0;  // expanded payload bytes
    uint32_t count = 0;  // expanded objects, saturating just above the limit
    State state = kUnvisited;
    uint8_t height = 0;  // container levels at and below this object
    Kind kind = Kind::Boolean;
  };

  bool fail(const char* why) {
    why_ = why;
    return false;
  }

  bool readTrailer();
  bool decode(uint64_t index, Object& o);
  bool readCount(size_t& pos, uint8_t low, uint64_t& count);
  bool checkPayload(const Object& o, uint64_t unit);
  bool decodeInteger(const Object& o, Integer& out) const;
  bool checkString(const Object& o, uint64_t& utf8Bytes);
  bool measureTop();
  bool measure(uint64_t index, size_t depth);
  bool measureContainer(uint64_t index, const Object& o, size_t depth);
  bool build(uint64_t index, Value& out);
  bool buildDictionary(const Object& o, Value& out);
  void buildString(const Object& o, uint64_t utf8Size, std::string& out) const;
  uint64_t ref(const Object& o, uint64_t i) const { return readBE(p_ + o.start + i * refSize_, refSize_); }

  const uint8_t* p_;
  size_t n_;
  const Limits limits_;
  size_t offsetSize_ = 0;
  size_t refSize_ = 0;
  uint64_t numObjects_ = 0;
  uint64_t top_ = 0;
  uint64_t tableOffset_ = 0;  // also the end of the object area
  uint64_t visits_ = 0;
  std::vector<Meta> meta_;
  const char* why_ = "";
};

bool BinaryReader::readTrailer() {
  if (n_ < kHeaderSize + 1 + kTrailerSize) return fail("too short for a binary plist");
  if (std::memcmp(p_, "bplist00", kHeaderSize) != 0) return fail("bad binary plist header");
  const uint8_t* t = p_ + n_ - kTrailerSize;
  offsetSize_ = t[6];
  refSize_ = t[7];
  numObjects_ = readBE(t + 8, 8);
  top_ = readBE(t + 16, 8);
  tableOffset_ = readBE(t + 24, 8);
  if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8) return fail("bad integer sizes in trailer");
  if (numObjects_ < 1 || top_ >= numObjects_) return fail("bad object count in trailer");
  // A well-formed file holds no unreachable objects, so a bigger table means
  // a bigger expansion.
  if (numObjects_ > limits_.maxObjects) return fail("too many objects");
  const uint64_t tableEnd = n_ - kTrailerSize;
  if (tableOffset_ <= kHeaderSize || tableOffset_ > tableEnd) return fail("offset table out of range");
  if (numObjects_ > (tableEnd - tableOffset_) / offsetSize_) return fail("offset table out of range");
  meta_.resize(numObjects_);
  return true;
}

bool BinaryReader::readCount(size_t& pos, uint8_t low, uint64_t& count) {
  if (low != 0xF) {
    count = low;
    return true;
  }
  if (pos >= tableOffset_) return fail("object out of range");
  const uint8_t marker = p_[pos++];
  if ((marker & 0xF0) != 0x10 || (marker & 0x0F) > 3) return fail("bad length marker");
  const size_t width = size_t{1} << (marker & 0x0F);
  if (width > tableOffset_ - pos) return fail("object out of range");
  count = readBE(p_ + pos, width);
  pos += width;
  return true;
}

bool BinaryReader::checkPayload(const Object& o, uint64_t unit) {
  if (o.count > (tableOffset_ - o.start) / unit) return fail("object out of range");
  return true;
}

bool BinaryReader::decode(uint64_t index, Object& o) {
  const uint64_t offset = readBE(p_ + tableOffset_ + index * offsetSize_, offsetSize_);
  if (offset < kHeaderSize || offset >= tableOffset_) return fail("object offset out of range");
  size_t pos = offset;
  const uint8_t marker = p_[pos++];
  const uint8_t low = marker & 0x0F;
  o = Object{Kind::Boolean, false, pos, 0};
  switch (marker >> 4) {
    case 0x0:
      if (marker != 0x08 && marker != 0x09) return fail("unsupported object type");
      o.flag = marker == 0x09;
      return true;
    case 0x1:
      if (low > 4) return fail("bad integer size");
      o.kind = Kind::Integer;
      o.count = uint64_t{1} << low;
      return checkPayload(o, 1);
    case 0x2:
      if (low != 2 && low != 3) return fail("bad real size");
      o.kind = Kind::Real;
      o.count = uint64_t{1} << low;
      return checkPayload(o, 1);
    case 0x3:
      if (marker != 0x33) return fail("bad date");
      o.kind = Kind::Date;
      o.count = 8;
      return checkPayload(o, 1);
    case 0x4: o.kind = Kind::Data; break;
    case 0x5: o.kind = Kind::Ascii; break;
    case 0x6: o.kind = Kind::Utf16; break;
    case 0xA: o.kind = Kind::Array; break;
    case 0xD: o.kind = Kind::Dictionary; break;
    default: return fail("unsupported object type");
  }
  if (!readCount(pos, low, o.count)) return false;
  o.start = pos;
  switch (o.kind) {
    case Kind::Utf16: return checkPayload(o, 2);
    case Kind::Array: return checkPayload(o, refSize_);
    case Kind::Dictionary: return checkPayload(o, 2 * refSize_);
    default: return checkPayload(o, 1);
  }
}

bool BinaryReader::decodeInteger(const Object& o, Integer& out) const {
  const uint8_t* q = p_ + o.start;
  if (o.count < 8) {
    out = Integer{readBE(q, o.count), false};
    return true;
  }
  if (o.count == 8) {
    out = Integer{readBE(q, 8), false};
    return true;
  }
  const uint64_t high = readBE(q, 8);
  const uint64_t low = readBE(q + 8, 8);
  if (high == 0) {
    out = Integer{low, low > INT64_MAX};
    return true;
  }
  if (high == UINT64_MAX && low > INT64_MAX) {  // a negative value in 128 bits
    out = Integer{low, false};
    return true;
  }
  return false;
}

bool BinaryReader::checkString(const Object& o, uint64_t& utf8Bytes) {
  const uint8_t* q = p_ + o.start;
  // NUL is refused as the XML reader refuses it: strings end up in system calls.
  if (o.kind == Kind::Ascii) {
    for (uint64_t i = 0; i < o.count; ++i) {
      if (q[i] >= 0x80) return fail("non-ASCII byte in ASCII string");
      if (q[i] == 0) return fail("NUL in string");
    }
    utf8Bytes = o.count;
    return true;
  }
  utf8Bytes = 0;
  for (uint64_t i = 0; i < o.count; ++i) {
    const uint32_t u = readBE(q + 2 * i, 2);
    if (u == 0) return fail("NUL in string");
    if (isHighSurrogate(u)) {
      if (i + 1 >= o.count || !isLowSurrogate(readBE(q + 2 * i + 2, 2))) return fail("invalid UTF-16 string");
      ++i;
      utf8Bytes += 4;
    } else if (isLowSurrogate(u)) {
      return fail("invalid UTF-16 string");
    } else {
      utf8Bytes += u < 0x80 ? 1 : u < 0x800 ? 2 : 3;
    }
  }
  return true;
}

bool BinaryReader::measureTop() {
  visits_ = 1;
  if (!measure(top_, 0)) return false;
  const Meta& m = meta_[top_];
  if (m.count > limits_.maxObjects) return fail("too many objects");
  if (m.count * kObjectFootprint + m.bytes > limits_.maxFootprint || m.bytes > limits_.maxBytes)
    return fail("too much data");
  return true;
}

// `depth` is the number of containers above the object.
bool BinaryReader::measure(uint64_t index, size_t depth) {
  Meta& m = meta_[index];
  if (m.state == kDone) {
    if (depth + m.height > limits_.maxDepth) return fail("nesting too deep");
    return true;
  }
  if (m.state == kActive) return fail("cyclic reference");
  Object o;
  if (!decode(index, o)) return false;
  m.kind = o.kind;
  m.count = 1;
  Integer ignored;
  switch (o.kind) {
    case Kind::Integer:
      if (!decodeInteger(o, ignored)) return fail("integer out of range");
      break;
    case Kind::Ascii:
    case Kind::Utf16:
      if (!checkString(o, m.bytes)) return false;
      break;
    case Kind::Data: m.bytes = o.count; break;
    case Kind::Array:
    case Kind::Dictionary: return measureContainer(index, o, depth);
    default: break;
  }
  m.state = kDone;
  return true;
}

bool BinaryReader::measureContainer(uint64_t index, const Object& o, size_t depth) {
  if (depth + 1 > limits_.maxDepth) return fail("nesting too deep");
  meta_[index].state = kActive;
  const uint64_t refs = o.kind == Kind::Dictionary ? 2 * o.count : o.count;
  uint64_t count = 1, bytes = 0;
  uint8_t height = 0;
  for (uint64_t i = 0; i < refs; ++i) {
    // Each reference scanned is at least one object of the expansion, so this
    // bounds the work even before the per-object counts add up.
    if (++visits_ > limits_.maxObjects) return fail("too many objects");
    const uint64_t child = ref(o, i);
    if (child >= numObjects_) return fail("object reference out of range");
    if (!measure(child, depth + 1)) return false;
    const Meta& c = meta_[child];  // meta_ never reallocates during a parse
    if (i < o.count && o.kind == Kind::Dictionary && c.kind != Kind::Ascii && c.kind != Kind::Utf16) {
      return fail("dictionary key is not a string");
    }
    count = std::min<uint64_t>(count + c.count, limits_.maxObjects + 1);
    bytes = saturatingAdd(bytes, c.bytes);
    if (bytes > limits_.maxFootprint || bytes > limits_.maxBytes) return fail("too much data");
    height = std::max(height, c.height);
  }
  Meta& m = meta_[index];
  if (count > limits_.maxObjects) return fail("too many objects");
  m.count = static_cast<uint32_t>(count);
  m.bytes = bytes;
  m.height = static_cast<uint8_t>(height + 1);
  m.state = kDone;
  return true;
}

// `utf8Size` is the length measure() found for the string.
void BinaryReader::buildString(const Object& o, uint64_t utf8Size, std::string& out) const {
  const uint8_t* q = p_ + o.start;
  out.clear();
  if (o.kind == Kind::Ascii) {
    out.assign(reinterpret_cast<const char*>(q), o.count);
    return;
  }
  out.reserve(utf8Size);
  for (uint64_t i = 0; i < o.count; ++i) {
    uint32_t c = readBE(q + 2 * i, 2);
    if (isHighSurrogate(c)) {  // validity checked while measuring
      c = 0x10000 + ((c - 0xD800) << 10) + (readBE(q + 2 * i + 2, 2) - 0xDC00);
      ++i;
    }
    appendUTF8(out, c);
  }
}

// Only reached after measure() accepted the whole graph, so decoding cannot
// fail here and the recursion is at most kMaxDepth deep.
bool BinaryReader::build(uint64_t index, Value& out) {
  Object o;
  if (!decode(index, o)) return false;
  const uint8_t* q = p_ + o.start;
  switch (o.kind) {
    case Kind::Boolean: out = Value(o.flag); return true;
    case Kind::Integer: {
      Integer i;
      decodeInteger(o, i);
      out = Value(i);
      return true;
    }
    case Kind::Real:
      out = Value(o.count == 4 ? floatFromBits(static_cast<uint32_t>(readBE(q, 4))) : doubleFromBits(readBE(q, 8)));
      return true;
    case Kind::Date: out = Value(Date{doubleFromBits(readBE(q, 8))}); return true;
    case Kind::Data: out = Value(Data(q, q + o.count)); return true;
    case Kind::Ascii:
    case Kind::Utf16: {
      std::string s;
      buildString(o, meta_[index].bytes, s);
      out = Value(std::move(s));
      return true;
    }
    case Kind::Array: {
      Array array(o.count);
      for (uint64_t i = 0; i < o.count; ++i) {
        if (!build(ref(o, i), array[i])) return false;
      }
      out = Value(std::move(array));
      return true;
    }
    case Kind::Dictionary: return buildDictionary(o, out);
  }
  return false;
}

// Duplicate keys are refused rather than resolved: two readers that resolve
// them differently would see different requests in the same bytes.
bool BinaryReader::buildDictionary(const Object& o, Value& out) {
  out = Value(Dictionary{});
  Dictionary& dictionary = out.dictionary();
  std::string key;
  for (uint64_t i = 0; i < o.count; ++i) {
    const uint64_t keyIndex = ref(o, i);
    Object keyObject;
    if (!decode(keyIndex, keyObject)) return false;
    buildString(keyObject, meta_[keyIndex].bytes, key);
    Dictionary::iterator it;
    if (dictionary.empty() || std::prev(dictionary.end())->first < key) {
      it = dictionary.try_emplace(dictionary.end(), std::move(key));  // sorted keys, the usual case
    } else {
      bool inserted;
      std::tie(it, inserted) = dictionary.try_emplace(std::move(key));
      if (!inserted) return fail("duplicate dictionary key");
    }
    if (!build(ref(o, o.count + i), it->second)) return false;
  }
  return true;
}

// Writes "bplist00": objects numbered depth-first from the top (0), equal
// strings and booleans written once, then the offset table and trailer with
// the smallest integer sizes that fit.
class BinaryWriter {
 public:
  Data write(const Value& top);

 private:
  // A string entry has `string` set (dictionary keys have no Value).
  struct Entry {
    const Value* value;
    const std::string* string;
    size_t refStart;
  };

  uint32_t flatten(const Value& v);
  uint32_t flattenString(const std::string& s);
  uint32_t add(const Value* value, const std::string* string, size_t refStart);
  void emit(const Entry& e);
  void emitCount(uint8_t type, uint64_t count);
  void emitInteger(const Integer& i);
  void emitString(const std::string& s);
  void put(uint64_t v, size_t width);

  std::vector<Entry> entries_;
  std::vector<uint32_t> refs_;
  std::unordered_map<std::string_view, uint32_t> strings_;
  uint32_t booleans_[2] = {UINT32_MAX, UINT32_MAX};
  std::vector<uint16_t> utf16_;
  size_t refSize_ = 1;
  Data out_;
};

size_t widthFor(uint64_t max) {
  if (max <= UINT8_MAX) return 1;
  if (max <= UINT16_MAX) return 2;
  if (max <= UINT32_MAX) return 4;
  return 8;
}

uint8_t integerMarker(size_t width) {
  return static_cast<uint8_t>(0x10 | (width == 1 ? 0 : width == 2 ? 1 : width == 4 ? 2 : 3));
}

uint32_t BinaryWriter::add(const Value* value, const std::string* string, size_t refStart) {
  entries_.push_back(Entry{value, string, refStart});
  return static_cast<uint32_t>(entries_.size() - 1);
}

uint32_t BinaryWriter::flattenString(const std::string& s) {
  auto [it, inserted] = strings_.try_emplace(s, 0);
  if (inserted) it->second = add(nullptr, &s, 0);
  return it->second;
}

uint32_t BinaryWriter::flatten(const Value& v) {
  if (const std::string* s = v.stringIf()) return flattenString(*s);
  if (const bool* b = v.booleanIf()) {
    uint32_t& slot = booleans_[*b ? 1 : 0];
    if (slot == UINT32_MAX) slot = add(&v, nullptr, 0);
    return slot;
  }
  const size_t refStart = refs_.size();
  const uint32_t self = add(&v, nullptr, refStart);
  if (const Array* array = v.arrayIf()) {
    refs_.resize(refStart + array->size());
    for (size_t i = 0; i < array->size(); ++i) refs_[refStart + i] = flatten((*array)[i]);
  } else if (const Dictionary* dictionary = v.dictionaryIf()) {
    const size_t n = dictionary->size();
    refs_.resize(refStart + 2 * n);
    size_t i = 0;
    for (const auto& [key, value] : *dictionary) refs_[refStart + i++] = flattenString(key);
    i = n;
    for (const auto& [key, value] : *dictionary) refs_[refStart + i++] = flatten(value);
  }
  return self;
}

void BinaryWriter::put(uint64_t v, size_t width) {
  for (size_t i = width; i-- > 0;) out_.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

void BinaryWriter::emitCount(uint8_t type, uint64_t count) {
  if (count < 0xF) {
    out_.push_back(static_cast<uint8_t>(type | count));
    return;
  }
  out_.push_back(type | 0xF);
  const size_t width = widthFor(count);
  out_.push_back(integerMarker(width));
  put(count, width);
}

void BinaryWriter::emitInteger(const Integer& i) {
  if (i.bits > INT64_MAX) {
    if (i.isUnsigned) {
      out_.push_back(0x14);
      put(0, 8);
    } else {
      out_.push_back(0x13);
    }
    put(i.bits, 8);
    return;
  }
  const size_t width = widthFor(i.bits);
  out_.push_back(integerMarker(width));
  put(i.bits, width);
}

// In-memory strings are UTF-8; a malformed sequence becomes U+FFFD rather
// than failing the write.
void BinaryWriter::emitString(const std::string& s) {
  const auto* q = reinterpret_cast<const uint8_t*>(s.data());
  const size_t n = s.size();
  if (std::all_of(q, q + n, [](uint8_t c) { return c < 0x80; })) {
    emitCount(0x50, n);
    out_.insert(out_.end(), q, q + n);
    return;
  }
  utf16_.clear();
  for (size_t i = 0; i < n;) {
    const uint8_t c = q[i];
    const size_t len = c < 0x80 ? 1 : (c >> 5) == 0x6 ? 2 : (c >> 4) == 0xE ? 3 : (c >> 3) == 0x1E ? 4 : 0;
    uint32_t cp = len == 1 ? c : len == 2 ? c & 0x1F : len == 3 ? c & 0x0F : c & 0x07;
    bool ok = len != 0 && i + len <= n;
    for (size_t k = 1; ok && k < len; ++k) {
      ok = (q[i + k] & 0xC0) == 0x80;
      cp = (cp << 6) | (q[i + k] & 0x3F);
    }
    static constexpr uint32_t kMinForLength[] = {0, 0, 0x80, 0x800, 0x10000};
    ok = ok && cp >= kMinForLength[len] && cp <= 0x10FFFF && !(cp >= 0xD800 && cp <= 0xDFFF);
    if (!ok) {
      utf16_.push_back(0xFFFD);
      ++i;
      continue;
    }
    if (cp >= 0x10000) {
      utf16_.push_back(static_cast<uint16_t>(0xD800 + ((cp - 0x10000) >> 10)));
      utf16_.push_back(static_cast<uint16_t>(0xDC00 + ((cp - 0x10000) & 0x3FF)));
    } else {
      utf16_.push_back(static_cast<uint16_t>(cp));
    }
    i += len;
  }
  emitCount(0x60, utf16_.size());
  for (uint16_t u : utf16_) put(u, 2);
}

void BinaryWriter::emit(const Entry& e) {
  if (e.string) return emitString(*e.string);
  const Value& v = *e.value;
  switch (v.type()) {
    case Type::Boolean: out_.push_back(v.boolean() ? 0x09 : 0x08); break;
    case Type::Integer: emitInteger(v.integer()); break;
    case Type::Real:
    case Type::Date: {
      const double d = v.isReal() ? v.real() : v.date().seconds;
      uint64_t bits;
      std::memcpy(&bits, &d, sizeof bits);
      out_.push_back(v.isReal() ? 0x23 : 0x33);
      put(bits, 8);
      break;
    }
    case Type::Data:
      emitCount(0x40, v.data().size());
      out_.insert(out_.end(), v.data().begin(), v.data().end());
      break;
    case Type::String: emitString(v.string()); break;
    case Type::Array:
    case Type::Dictionary: {
      const size_t n = v.isArray() ? v.array().size() : v.dictionary().size();
      emitCount(v.isArray() ? 0xA0 : 0xD0, n);
      const size_t refs = v.isArray() ? n : 2 * n;
      for (size_t i = 0; i < refs; ++i) put(refs_[e.refStart + i], refSize_);
      break;
    }
  }
}

Data BinaryWriter::write(const Value& top) {
  flatten(top);
  refSize_ = widthFor(entries_.size() - 1);
  out_.reserve(kHeaderSize + kTrailerSize + entries_.size() * 10 + refs_.size() * refSize_);
  static const uint8_t kMagic[] = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  out_.insert(out_.end(), kMagic, kMagic + kHeaderSize);
  std::vector<uint64_t> offsets(entries_.size());
  for (size_t i = 0; i < entries_.size(); ++i) {
    offsets[i] = out_.size();
    emit(entries_[i]);
  }
  const uint64_t tableOffset = out_.size();
  const size_t offsetSize = widthFor(tableOffset);
  for (uint64_t offset : offsets) put(offset, offsetSize);
  put(0, 6);
  out_.push_back(static_cast<uint8_t>(offsetSize));
  out_.push_back(static_cast<uint8_t>(refSize_));
  put(entries_.size(), 8);
  put(0, 8);
  put(tableOffset, 8);
  return std::move(out_);
}

bool startsLikeXML(const uint8_t* p, size_t n) {
  size_t i = 0;
  if (n >= 3 && p[0] == 0xEF && p[1] == 0xBB && p[2] == 0xBF) i = 3;
  while (i < n && (p[i] == ' ' || p[i] == '\t' || p[i] == '\r' || p[i] == '\n')) ++i;
  return i < n && p[i] == '<';
}

}  // namespace

std::optional<Value> parseBinary(const void* bytes, size_t length, std::string* error, uint64_t* footprint,
                                 const Limits& limits) {
  return BinaryReader(static_cast<const uint8_t*>(bytes), length, limits).read(error, footprint);
}

Data writeBinary(const Value& value) { return BinaryWriter().write(value); }

std::optional<Value> parse(const void* bytes, size_t length, std::string* error, const Limits& limits) {
  const auto* p = static_cast<const uint8_t*>(bytes);
  if (length >= kHeaderSize && std::memcmp(p, "bplist00", kHeaderSize) == 0)
    return parseBinary(bytes, length, error, nullptr, limits);
  if (startsLikeXML(p, length)) return parseXML(bytes, length, error);
  if (error) *error = "unknown format";
  return std::nullopt;
}

}  // namespace quarterkit::plist
