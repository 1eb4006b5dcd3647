#include "QuarterKit/Upcall.h"

#include <errno.h>
#include <poll.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>

#include "base/Frame.h"
#include "packbuff/packbuff.h"

namespace quarterkit {

namespace {

// The largest answer accepted: far above any real list of containers.
constexpr uint32_t kMaxAnswer = 16u << 20;

void appendU32(std::vector<uint8_t>& out, uint32_t v) {
  uint8_t b[4];
  memcpy(b, &v, 4);
  out.insert(out.end(), b, b + 4);
}

void readAnswerItems(std::vector<uint8_t>& bytes, UpcallAnswer* answer) {
  sb_packbuff* pb = sb_packbuff_init_with_buffer(bytes.data(), bytes.size(), true, SB_PACKBUFF_DEALLOC_NONE);
  if (!pb) return;
  uint16_t type = 0;
  int rc = 0;
  auto str = [&]() -> std::string {
    const char* s = sb_packbuff_unpack_string(pb, nullptr, &rc);
    return s ? s : "";
  };
  while (rc == 0 && sb_packbuff_get_item_value_type(pb, &type)) {
    switch (type) {
      case 0: answer->status = sb_packbuff_unpack_uint32(pb, &rc); break;
      case 1: answer->dataContainer = str(); break;
      case 2: answer->tempDir = str(); break;
      case 100: answer->home = str(); break;
      case 101: answer->systemContainer = str(); break;
      case 3:
      case 102: {
        const char *key = nullptr, *value = nullptr;
        uint16_t valueType = 0;
        rc = sb_packbuff_unpack_key_with_string_value(pb, &key, &valueType, &value, nullptr);
        if (rc == 0 && valueType != type + 1) rc = EINVAL;
        if (rc == 0) (type == 3 ? answer->groups : answer->systemGroups).emplace_back(key, value);
        break;
      }
      default: rc = EINVAL; break;
    }
  }
  answer->readable = rc == 0 && sb_packbuff_at_end(pb);
  sb_packbuff_free(pb);
}

}  // namespace

std::string upcallSocketPath(const std::string& deviceRoot) {
  std::string root = deviceRoot;
  while (!root.empty() && root.back() == '/') root.pop_back();
  // No root: this machine's daemon, in the host profile's place.
  if (root.empty()) return "/run/quarterd/upcall.sock";
  return root + "/run/com.norvane.quarterd.upcall";
}

std::vector<uint8_t> packUpcallRequest(const UpcallRequest& request) {
  sb_packbuff* pb = sb_packbuff_new(512);
  if (!pb) return {};
  auto str = [pb](uint16_t type, const std::string& s) { sb_packbuff_pack_string(pb, type, s.c_str(), s.size()); };
  if (request.codeSignatureId) str(0, *request.codeSignatureId);
  if (request.containerId) str(1, *request.containerId);
  if (request.applicationId) str(2, *request.applicationId);
  if (request.personaId) sb_packbuff_pack_uint32(pb, 3, *request.personaId);
  for (const std::string& g : request.appGroupIds) str(4, g);
  if (request.containerType) sb_packbuff_pack_uint32(pb, 5, *request.containerType);
  if (request.systemContainerId) str(6, *request.systemContainerId);
  for (const std::string& g : request.systemGroupIds) str(7, g);
  const uint8_t* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb));
  std::vector<uint8_t> out(bytes, bytes + sb_packbuff_get_size(pb));
  sb_packbuff_free(pb);
  return out;
}

std::unique_ptr<UpcallClient> UpcallClient::connect(const std::string& socketPath, std::string* error) {
  sockaddr_un address{};
  if (socketPath.size() >= sizeof address.sun_path) {
    if (error) *error = "socket path too long";
    return nullptr;
  }
  address.sun_family = AF_UNIX;
  memcpy(address.sun_path, socketPath.c_str(), socketPath.size() + 1);
  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0 || ::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    if (error) *error = strerror(errno);
    if (fd >= 0) ::close(fd);
    return nullptr;
  }
  timeval timeout{30, 0};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
  return std::unique_ptr<UpcallClient>(new UpcallClient(fd));
}

UpcallClient::~UpcallClient() { ::close(fd_); }

bool UpcallClient::send(const UpcallFrame& frame, std::span<const uint8_t> region) {
  const uint32_t size = frame.regionSize.value_or(static_cast<uint32_t>(region.size()));
  std::vector<uint8_t> out;
  out.reserve(24 + region.size());
  for (uint32_t v :
       {frame.id, frame.bits, frame.descriptorCount, frame.descriptorType, size, frame.requestSize.value_or(size)})
    appendU32(out, v);
  out.insert(out.end(), region.begin(), region.end());
  return frame::sendAll(fd_, out.data(), out.size());
}

std::optional<UpcallAnswer> UpcallClient::receive() {
  uint8_t header[12];
  if (!frame::recvAll(fd_, header, sizeof header)) return std::nullopt;
  UpcallAnswer answer;
  uint32_t size = 0;
  memcpy(&answer.replyId, header, 4);
  memcpy(&answer.returnCode, header + 4, 4);
  memcpy(&size, header + 8, 4);
  if (size > kMaxAnswer) return std::nullopt;
  std::vector<uint8_t> bytes(size);
  if (!frame::recvAll(fd_, bytes.data(), size)) return std::nullopt;
  if (answer.returnCode == 0) readAnswerItems(bytes, &answer);
  return answer;
}

std::optional<UpcallAnswer> UpcallClient::call(const UpcallRequest& request) {
  std::vector<uint8_t> region = packUpcallRequest(request);
  if (!send(UpcallFrame{}, region)) return std::nullopt;
  return receive();
}

bool UpcallClient::closedByPeer() {
  pollfd p{fd_, POLLIN, 0};
  if (::poll(&p, 1, 5000) <= 0) return false;
  uint8_t byte;
  return ::recv(fd_, &byte, 1, MSG_PEEK | MSG_DONTWAIT) == 0 || (p.revents & (POLLHUP | POLLERR));
}

}  // namespace quarterkit
