#include "Daemon/codesign/QRTCodeSigningEntry.h"

#include <functional>

#include "base/QRTFormat.h"

namespace {

size_t combine(size_t seed, size_t value) { return seed ^ (value + 0x9e3779b97f4a7c15ull + (seed << 6) + (seed >> 2)); }

size_t hashValue(const plist::Value& value) {
  size_t h = static_cast<size_t>(value.type());
  switch (value.type()) {
    case plist::Type::Boolean: return combine(h, value.boolean());
    case plist::Type::Integer: return combine(h, std::hash<uint64_t>{}(value.integer().bits));
    case plist::Type::Real: return combine(h, std::hash<double>{}(value.real()));
    case plist::Type::Date: return combine(h, std::hash<double>{}(value.date().seconds));
    case plist::Type::String: return combine(h, std::hash<std::string>{}(value.string()));
    case plist::Type::Data:
      return combine(h, std::hash<std::string_view>{}(
                            std::string_view(reinterpret_cast<const char*>(value.data().data()), value.data().size())));
    case plist::Type::Array:
      for (const plist::Value& item : value.array()) h = combine(h, hashValue(item));
      return h;
    case plist::Type::Dictionary:
      for (const auto& [key, item] : value.dictionary()) {
        h = combine(combine(h, std::hash<std::string>{}(key)), hashValue(item));
      }
      return h;
  }
  return h;
}

plist::Value childArray(const std::vector<std::string>& children) {
  plist::Array array;
  array.reserve(children.size());
  for (const std::string& child : children) array.emplace_back(child);
  return array;
}

bool flagOf(const plist::Dictionary& dictionary, const char* key) {
  const plist::Value* v = plist::find(dictionary, key);
  if (!v) return false;
  if (const bool* b = v->booleanIf()) return *b;
  if (const plist::Integer* i = v->integerIf()) return i->bits != 0;
  return false;
}

}  // namespace

QRTCodeSigningEntry QRTCodeSigningEntry::fromSerializedDictionary(const plist::Dictionary& dictionary) {
  QRTCodeSigningEntry entry;
  if (const plist::Value* info = plist::find(dictionary, "CodeSigningInfo")) {
    if (const plist::Dictionary* d = info->dictionaryIf()) entry.codeSigningInfo = *d;
  }
  if (const plist::Value* children = plist::find(dictionary, "ChildBundleIds")) {
    if (const plist::Array* array = children->arrayIf()) {
      std::vector<std::string> identifiers;
      for (const plist::Value& child : *array) {
        if (const std::string* s = child.stringIf()) identifiers.push_back(*s);
      }
      entry.childBundleIdentifiers = std::move(identifiers);
    }
  }
  entry.invalid = flagOf(dictionary, "Invalid");
  entry.placeholder = flagOf(dictionary, "Placeholder");
  entry.registeredByCaller = flagOf(dictionary, "RegisteredByCaller");
  if (const plist::Value* cls = plist::find(dictionary, "DataContainerClass")) {
    if (const plist::Integer* i = cls->integerIf()) entry.dataContainerClass = i->asUnsigned();
  }
  return entry;
}

plist::Dictionary QRTCodeSigningEntry::serialize() const {
  plist::Dictionary d;
  if (codeSigningInfo) d["CodeSigningInfo"] = *codeSigningInfo;
  if (childBundleIdentifiers) d["ChildBundleIds"] = childArray(*childBundleIdentifiers);
  d["Invalid"] = invalid;
  d["Placeholder"] = placeholder;
  d["RegisteredByCaller"] = registeredByCaller;
  d["DataContainerClass"] = static_cast<unsigned long long>(dataContainerClass);
  return d;
}

bool QRTCodeSigningEntry::operator==(const QRTCodeSigningEntry& other) const {
  if (this == &other) return true;
  return codeSigningInfo == other.codeSigningInfo && childBundleIdentifiers == other.childBundleIdentifiers &&
         invalid == other.invalid && placeholder == other.placeholder &&
         registeredByCaller == other.registeredByCaller && dataContainerClass == other.dataContainerClass;
}

size_t QRTCodeSigningEntry::hash() const {
  size_t h = (codeSigningInfo ? hashValue(*codeSigningInfo) : 0) ^
             (childBundleIdentifiers ? hashValue(childArray(*childBundleIdentifiers)) : 0);
  if (invalid) h += 2;
  if (placeholder) h += 4;
  if (registeredByCaller) h += 8;
  if (dataContainerClass != 0) h += 16;
  return h;
}

std::string QRTCodeSigningEntry::description() const {
  auto yn = [](bool b) { return b ? 'Y' : 'N'; };
  std::optional<plist::Value> children;
  if (childBundleIdentifiers) children = childArray(*childBundleIdentifiers);
  std::optional<plist::Value> info;
  if (codeSigningInfo) info = plist::Value(*codeSigningInfo);
  return QRTFormat("<%@ invalid: %c, placeholder: %c, regByCaller: %c, dataClass: %llu, childBundles: %@, CSinfo: %@>",
                   "QRTCodeSigningEntry", yn(invalid), yn(placeholder), yn(registeredByCaller),
                   static_cast<unsigned long long>(dataContainerClass), children, info);
}
