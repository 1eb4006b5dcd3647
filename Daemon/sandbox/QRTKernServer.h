// The kernel upcall server: tells the sandbox, as a process starts, where its
// data, temporary, home, group, system and system group containers are,
// creating them when missing. Served on each kernel connection's own thread,
// several at once: the data class comes from the code-signing snapshot and
// existing containers are found under the shared side of the all-identifiers
// lock, so an upcall that makes nothing neither waits for another thread nor
// reads the database.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <vector>

#include "platform/UpcallSocket.h"

inline constexpr uint32_t QRTKernServerRoutineId = 322514900;
inline constexpr uint32_t QRTKernServerIdBase = 161257450;  // both ids of the server, halved
inline constexpr uint32_t QRTKernServerReplyIdOffset = 100;

// Request item value types.
enum : uint16_t {
  QK_KERN_REQUEST_CODE_SIGNATURE_ID = 0,
  QK_KERN_REQUEST_CONTAINER_ID = 1,
  QK_KERN_REQUEST_APPLICATION_ID = 2,
  QK_KERN_REQUEST_PERSONA_ID = 3,
  QK_KERN_REQUEST_APP_GROUP_ID = 4,
  QK_KERN_REQUEST_CONTAINER_TYPE = 5,
  QK_KERN_REQUEST_SYSTEM_CONTAINER_ID = 6,
  QK_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID = 7,
};

// Reply item value types.
enum : uint16_t {
  QK_KERN_REPLY_STATUS = 0,
  QK_KERN_REPLY_DATA_CONTAINER = 1,
  QK_KERN_REPLY_TEMP_DIR = 2,
  QK_KERN_REPLY_GROUP_ID = 3,
  QK_KERN_REPLY_GROUP_PATH = 4,
  QK_KERN_REPLY_HOME_DIR = 100,
  QK_KERN_REPLY_SYSTEM_CONTAINER = 101,
  QK_KERN_REPLY_SYSTEM_GROUP_ID = 102,
  QK_KERN_REPLY_SYSTEM_GROUP_PATH = 103,
};

// What the frame alone decides: NotOurs closes the connection; a non-zero
// *returnCode answers without serving. Pure, for fuzzing.
enum class QRTKernVerdict { NotOurs, Answer, Serve };
QRTKernVerdict QRTKernCheckRequest(const platform::UpcallMessage& request, int32_t* returnCode);

// The demultiplexer: false when the message is not this server's.
bool demux_server(const platform::UpcallMessage& request, platform::UpcallReply* reply);

// senderPid comes from the peer's credentials (0 for the kernel). Return
// code 0 with the reply packed buffer in *reply, or a failure code.
int32_t server_get_process_containers(const uint8_t* request, size_t requestSize, pid_t senderPid,
                                      std::vector<uint8_t>* reply);
