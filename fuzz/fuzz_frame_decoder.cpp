// Arbitrary bytes on the request socket: split into chunks of random sizes
// (as reads return them), framed, and every frame's payload decoded. A decoded
// message must also survive being written and read back.
#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "base/Frame.h"
#include "base/PlistCodec.h"

namespace {

// Deterministic per input, so a crash reproduces.
uint32_t nextRandom(uint32_t& state) {
  state ^= state << 13;
  state ^= state >> 17;
  state ^= state << 5;
  return state;
}

void decodeFrames(frame::Decoder& decoder) {
  while (auto f = decoder.next()) {
    auto message = frame::decodeMessage(f->payload);
    if (!message) continue;
    std::vector<uint8_t> again = frame::encode(f->messageId, *message);
    frame::Decoder reader;
    reader.append(again.data(), again.size());
    auto reframed = reader.next();
    if (!reframed || reframed->messageId != f->messageId || reader.buffered() != 0) abort();
    if (!frame::decodeMessage(reframed->payload)) abort();
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 4) return 0;
  uint32_t state = (uint32_t(data[0]) | uint32_t(data[1]) << 8 | uint32_t(data[2]) << 16 | uint32_t(data[3]) << 24) | 1;
  data += 4;
  size -= 4;
  frame::Decoder decoder;
  size_t offset = 0;
  while (offset < size && !decoder.failed()) {
    size_t chunk = 1 + nextRandom(state) % 256;
    if (chunk > size - offset) chunk = size - offset;
    decoder.append(data + offset, chunk);
    offset += chunk;
    decodeFrames(decoder);
  }
  return 0;
}
