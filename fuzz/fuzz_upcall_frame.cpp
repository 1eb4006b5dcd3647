// Arbitrary bytes on the upcall socket: cut into frames as reads return them
// (chunks of random sizes), each frame judged as the server judges it. Frames
// must tile the stream exactly and their regions stay inside it.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <span>
#include <vector>

#include "Daemon/sandbox/QRTKernServer.h"
#include "platform/Log.h"
#include "platform/UpcallSocket.h"

namespace {

uint32_t nextRandom(uint32_t& state) {
  state ^= state << 13;
  state ^= state >> 17;
  state ^= state << 5;
  return state;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // The server logs every refusal; without an open log each line would go
  // to the system log.
  if (!platform::logOpen("/dev/null", "fuzz_upcall_frame", 0)) abort();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 4) return 0;
  uint32_t state = (uint32_t(data[0]) | uint32_t(data[1]) << 8 | uint32_t(data[2]) << 16 | uint32_t(data[3]) << 24) | 1;
  data += 4;
  size -= 4;
  std::vector<uint8_t> buffer;
  size_t offset = 0;
  while (offset < size) {
    size_t chunk = 1 + nextRandom(state) % 512;
    if (chunk > size - offset) chunk = size - offset;
    buffer.insert(buffer.end(), data + offset, data + offset + chunk);
    offset += chunk;
    for (;;) {
      platform::UpcallMessage message;
      size_t consumed = 0;
      platform::UpcallParse parsed = platform::parseUpcallFrame(buffer, &message, &consumed);
      if (parsed == platform::UpcallParse::TooLarge) return 0;
      if (parsed == platform::UpcallParse::NeedMore) break;
      if (consumed != platform::kUpcallHeaderSize + message.regionSize || consumed > buffer.size()) abort();
      if (message.region.data() != buffer.data() + platform::kUpcallHeaderSize) abort();
      message.credentialsValid = (state & 1) != 0;
      message.pid = 1;  // never the kernel: nothing is created
      platform::UpcallReply reply;
      if (demux_server(message, &reply)) {
        int32_t code = 0;
        if (QRTKernCheckRequest(message, &code) == QRTKernVerdict::Serve && reply.returnCode != 5) abort();
        std::vector<uint8_t> frame = platform::encodeUpcallReply(reply);
        if (frame.size() != 12 + (reply.returnCode == 0 ? reply.data.size() : 0)) abort();
      }
      buffer.erase(buffer.begin(), buffer.begin() + static_cast<ptrdiff_t>(consumed));
    }
  }
  return 0;
}
