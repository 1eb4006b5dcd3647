// Our strict property-list codec. Bytes come from clients and from files that
// programs can write, so every reader bounds depth, object count and offsets,
// and a violation is a parse failure, never a crash or an unbounded allocation.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "base/PlistValue.h"

namespace plist {

constexpr size_t kMaxDepth = 64;
constexpr size_t kMaxObjects = 1'000'000;  // after expansion of shared references

// Binary ("bplist00") or XML, chosen by the leading bytes. On failure returns
// nothing and, when given, puts a short reason into *error.
std::optional<Value> parse(const void* bytes, size_t length, std::string* error = nullptr);
std::optional<Value> parseBinary(const void* bytes, size_t length, std::string* error = nullptr);
std::optional<Value> parseXML(const void* bytes, size_t length, std::string* error = nullptr);

// The binary format, version 00. Unsigned integers above INT64_MAX are written
// as 16-byte integers, the way other writers of the format do.
Data writeBinary(const Value& value);

}  // namespace plist
