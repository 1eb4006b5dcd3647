// Our strict property-list codec. Bytes come from clients and from files that
// programs can write, so every reader bounds depth, object count and offsets,
// and a violation is a parse failure, never a crash or an unbounded allocation.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "base/PlistValue.h"

namespace quarterkit::plist {

constexpr size_t kMaxDepth = 64;
constexpr size_t kMaxObjects = 1'000'000;  // after expansion of shared references
// What a binary property list may cost in memory once built: its strings and
// data as often as they are reached, plus a fixed cost per object. It holds
// whatever the input's size, so a few kilobytes of shared references cannot
// become a hundred megabytes.
constexpr uint64_t kMaxFootprint = 96ull << 20;

// Tighter bounds for a reader whose values are kept for long (the default
// ones are the most any reader accepts). maxBytes bounds the strings and data
// as often as they are reached.
struct Limits {
  size_t maxDepth = kMaxDepth;
  size_t maxObjects = kMaxObjects;
  uint64_t maxFootprint = kMaxFootprint;
  uint64_t maxBytes = kMaxFootprint;
};

// Binary ("bplist00") or XML, chosen by the leading bytes. On failure returns
// nothing and, when given, puts a short reason into *error.
std::optional<Value> parse(const void* bytes, size_t length, std::string* error = nullptr, const Limits& limits = {});
// *footprint, when given, receives the built value's estimated memory cost.
std::optional<Value> parseBinary(const void* bytes, size_t length, std::string* error = nullptr,
                                 uint64_t* footprint = nullptr, const Limits& limits = {});
std::optional<Value> parseXML(const void* bytes, size_t length, std::string* error = nullptr);

// The binary format, version 00. Unsigned integers above INT64_MAX are written
// as 16-byte integers, the way other writers of the format do.
Data writeBinary(const Value& value);

}  // namespace quarterkit::plist
