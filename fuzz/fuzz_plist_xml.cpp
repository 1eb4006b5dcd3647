// Arbitrary bytes into the XML property-list reader: it must refuse or accept
// without crashing, leaking or growing past its limits.
#include <cstddef>
#include <cstdint>
#include <string>

#include "base/PlistCodec.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::string error;
  auto value = plist::parseXML(data, size, &error);
  if (!value && error.empty()) __builtin_trap();  // every refusal says why
  return 0;
}
