// The kernel side of the upcall socket, as the sandbox launcher (and tests)
// use it: build a request packed buffer, send it in a frame, read the answer.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <utility>
#include <vector>

namespace quarterkit {

// R + "/run/com.norvane.quarterd.upcall"; "/" or "" (no root) gives the host
// daemon's /run/quarterd/upcall.sock.
std::string upcallSocketPath(const std::string& deviceRoot = "/");

struct UpcallRequest {
  std::optional<std::string> codeSignatureId, containerId, applicationId, systemContainerId;
  std::optional<uint32_t> personaId, containerType;
  std::vector<std::string> appGroupIds, systemGroupIds;
};
// The request packed buffer.
std::vector<uint8_t> packUpcallRequest(const UpcallRequest& request);

// The frame's fields; the defaults make a well-formed request for a region
// of regionSize bytes (requestSize follows regionSize unless set).
struct UpcallFrame {
  uint32_t id = 322514900;
  uint32_t bits = 0x80000000u;
  uint32_t descriptorCount = 1;
  uint32_t descriptorType = 1;
  std::optional<uint32_t> regionSize{};
  std::optional<uint32_t> requestSize{};
};

struct UpcallAnswer {
  uint32_t replyId = 0;
  int32_t returnCode = 0;
  // Items of the reply packed buffer (return code 0 only); readable is false
  // when the buffer could not be read whole.
  bool readable = false;
  std::optional<uint32_t> status;
  std::optional<std::string> home, dataContainer, tempDir, systemContainer;
  std::vector<std::pair<std::string, std::string>> groups, systemGroups;
};

class UpcallClient {
 public:
  // nullptr with a reason in *error when it cannot connect.
  static std::unique_ptr<UpcallClient> connect(const std::string& socketPath, std::string* error = nullptr);
  ~UpcallClient();

  // Sends a frame around region; regionSize in frame overrides the header's
  // size field only (the bytes sent are region's).
  bool send(const UpcallFrame& frame, std::span<const uint8_t> region);
  // The next answer; nothing when the daemon closed the connection (or 30 s passed).
  std::optional<UpcallAnswer> receive();
  std::optional<UpcallAnswer> call(const UpcallRequest& request);
  // Whether the daemon has closed the connection (waits up to 5 s for it).
  bool closedByPeer();

 private:
  explicit UpcallClient(int fd) : fd_(fd) {}
  int fd_;
};

}  // namespace quarterkit

namespace qk = quarterkit;
