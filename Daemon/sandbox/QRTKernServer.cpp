#include "Daemon/sandbox/QRTKernServer.h"

#include <errno.h>

#include <exception>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/QRTMetrics.h"
#include "Daemon/codesign/QRTCodeSigningMapping.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTLocks.h"
#include "Daemon/store/QRTContentClass.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTMetadata.h"
#include "Daemon/store/QRTPerUserConfiguration.h"
#include "packbuff/packbuff.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

using platform::kLogDebug;
using platform::kLogError;
using platform::kLogNotice;

namespace {

constexpr uint32_t kComplexBit = 0x80000000u;
constexpr uint32_t kOutOfLineDescriptor = 1;

struct KernRequest {
  std::optional<std::string> codeSignatureId, containerId, applicationId, systemContainerId;
  uint32_t personaId = 0;
  uint32_t containerType = 0;
  std::vector<std::string> appGroupIds, systemGroupIds;
};

std::optional<std::string> unpackToString(sb_packbuff* pb, const char* label) {
  int error = 0;
  size_t length = 0;
  const char* s = sb_packbuff_unpack_string(pb, &length, &error);
  if (!s) {
    QRTLog(kLogError, "failed: to unpack string for %s. error: %d\n", label, error);
    return std::nullopt;
  }
  return std::string(s, length);
}

// 0, or the server's return code for a request it cannot read.
int32_t readRequest(sb_packbuff* pb, KernRequest* request) {
  uint16_t type = 0;
  while (sb_packbuff_get_item_value_type(pb, &type)) {
    int error = 0;
    std::optional<std::string> s;
    switch (type) {
      case QK_KERN_REQUEST_CODE_SIGNATURE_ID:
        if (!(s = unpackToString(pb, "QK_KERN_REQUEST_CODE_SIGNATURE_ID"))) return 5;
        request->codeSignatureId = s;
        break;
      case QK_KERN_REQUEST_CONTAINER_ID:
        if (!(s = unpackToString(pb, "QK_KERN_REQUEST_CONTAINER_ID"))) return 5;
        request->containerId = s;
        break;
      case QK_KERN_REQUEST_APPLICATION_ID:
        if (!(s = unpackToString(pb, "QK_KERN_REQUEST_APPLICATION_ID"))) return 5;
        request->applicationId = s;
        break;
      case QK_KERN_REQUEST_PERSONA_ID:
        request->personaId = sb_packbuff_unpack_uint32(pb, &error);
        if (error) {
          QRTLog(kLogError, "failed: to unpack uint32 for QK_KERN_REQUEST_PERSONA_ID. error: %d\n", error);
          return 5;
        }
        break;
      case QK_KERN_REQUEST_APP_GROUP_ID:
        if (!(s = unpackToString(pb, "QK_KERN_REQUEST_APP_GROUP_ID"))) return 5;
        request->appGroupIds.push_back(*s);
        break;
      case QK_KERN_REQUEST_CONTAINER_TYPE:
        request->containerType = sb_packbuff_unpack_uint32(pb, &error);
        if (error) {
          QRTLog(kLogError, "failed: to unpack uint32 for QK_KERN_REQUEST_CONTAINER_TYPE. error: %d\n", error);
          return 5;
        }
        break;
      case QK_KERN_REQUEST_SYSTEM_CONTAINER_ID:
        if (!(s = unpackToString(pb, "QK_KERN_REQUEST_CONTAINER_ID"))) return 5;
        request->systemContainerId = s;
        break;
      case QK_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID:
        if (!(s = unpackToString(pb, "QK_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID"))) return 5;
        request->systemGroupIds.push_back(*s);
        break;
      default: QRTLog(kLogError, "unexpected value: %u\n", unsigned{type}); return 4;
    }
  }
  // Stopping short of a whole end marker is a cut buffer, not a finished one.
  if (!sb_packbuff_at_end(pb)) {
    QRTLog(kLogError, "request packbuff ends without its end marker");
    return 5;
  }
  return 0;
}

// The data container's class: the mapped class when it is a per-user one
// (a plug-in's always the plug-in class), else the sandbox's type decides.
uint64_t dataContainerClass(const std::string& identifier, uint32_t containerType) {
  QRTCodeSigningMapping* mapping = QRTCodeSigningMapping::sharedInstance();
  uint64_t cls = mapping ? mapping->dataContainerTypeForIdentifier(identifier) : 0;
  if (QRTIsPerUserClass(cls)) {
    if (containerType == 1 && cls != QRTClassAddonData) {
      QRTLog(kLogNotice, "SB Type: %u, EM Type: %llu.  Declaring this a plugin", containerType,
             static_cast<unsigned long long>(cls));
      return QRTClassAddonData;
    }
    if (containerType == 0 && cls != QRTClassAppData) {
      QRTLog(kLogNotice, "SB type is app, but EM type is %llu", static_cast<unsigned long long>(cls));
    }
    return cls;
  }
  QRTLog(kLogError, "Invalid data container class for %@: %llu", identifier, static_cast<unsigned long long>(cls));
  cls = containerType == 1 ? 4 : 2;
  QRTLog(kLogNotice, "SB Type: %u, falling back to class: %llu", containerType, static_cast<unsigned long long>(cls));
  return cls;
}

// An existing container is found under the shared side of the
// all-identifiers lock, beside other look-ups; only one that must be made
// goes on to the create path, which takes the write side.
QRTMetadataRef lookupOrCreate(const QRTContainerKey& key, uint64_t* error) {
  {
    QRTAllIdentifiersLock shared(false);
    QRTMetadataRef found = QRTContainerCache::sharedInstance().containerForUser(key, nullptr);
    if (found) return found;
  }
  return QRTClientConnection::sharedClientConnection().createOrLookupContainerForUser(
      key, QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, error);
}

struct Resolved {
  std::optional<QRTURL> dataContainer, systemContainer, home;
  std::vector<std::pair<std::string, std::string>> groups, systemGroups;  // request order
};

// Creates or finds every container asked for; false when one failed (each
// failure logged, the rest still tried).
bool resolveContainers(const KernRequest& request, const std::optional<std::string>& identifier, Resolved* out) {
  bool ok = true;
  uint64_t error = 1;
  if (identifier) {
    uint64_t cls = dataContainerClass(*identifier, request.containerType);
    QRTMetadataRef m = lookupOrCreate({request.personaId, cls, identifier}, &error);
    if (m) {
      out->dataContainer = m->url();
    } else {
      QRTLog(kLogError, "createOrLookupContainerForUser: Failed with error: %llu",
             static_cast<unsigned long long>(error));
      ok = false;
    }
  }
  if (request.systemContainerId) {
    QRTMetadataRef m =
        lookupOrCreate({QRTSystemContainerUserId, QRTClassSystemData, request.systemContainerId}, &error);
    if (m) {
      out->systemContainer = m->url();
    } else {
      QRTLog(kLogError, "createOrLookupContainerForUser:(system container) Failed with error: %llu",
             static_cast<unsigned long long>(error));
      ok = false;
    }
  }
  for (const std::string& group : request.appGroupIds) {
    QRTMetadataRef m = lookupOrCreate({request.personaId, QRTClassAppGroup, group}, &error);
    if (m) {
      out->groups.emplace_back(group, m->url().path());
    } else {
      QRTLog(kLogError, "createOrLookupGroupContainersForUser: Failed with error: %llu",
             static_cast<unsigned long long>(error));
      ok = false;
    }
  }
  for (const std::string& group : request.systemGroupIds) {
    QRTMetadataRef m = lookupOrCreate({QRTSystemContainerUserId, QRTClassSystemGroup, group}, &error);
    if (m) {
      out->systemGroups.emplace_back(group, m->url().path());
    } else {
      QRTLog(kLogError, "createOrLookupContainerForUser:(system group container) Failed with error: %llu",
             static_cast<unsigned long long>(error));
      ok = false;
    }
  }
  return ok;
}

std::optional<QRTURL> homeDirectory(uint32_t personaId) {
  if (personaId == 0) return QRTURL::fileURL(platform::hostPath("/private/var/root"), true);
  auto config = QRTGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(personaId);
  if (!config || !config->userHomeDirectory()) {
    QRTLog(kLogError, "No home directory for persona %u", personaId);
    return std::nullopt;
  }
  return config->userHomeDirectory();
}

std::string describeGroups(const std::vector<std::pair<std::string, std::string>>& groups) {
  std::string out = "{";
  for (const auto& [id, path] : groups) out += " " + id + " = " + path + ";";
  return out + (groups.empty() ? "}" : " }");
}

// Packs the answer in the fixed order; false at the first item that fails.
bool packAnswer(sb_packbuff* pb, const Resolved& r) {
  auto packPath = [pb](uint16_t type, const std::optional<QRTURL>& url) {
    if (!url) return true;
    int rc = sb_packbuff_pack_string(pb, type, url->path().c_str(), url->path().size());
    if (rc)
      QRTLog(kLogError, "sb_packbuff_pack_string() fails: %d; type: %u, path: %s\n", rc, unsigned{type},
             url->path().c_str());
    return rc == 0;
  };
  auto packPairs = [pb](const std::vector<std::pair<std::string, std::string>>& pairs, uint16_t keyType,
                        uint16_t valueType, const char* what) {
    for (const auto& [id, path] : pairs) {
      int rc = sb_packbuff_pack_key_with_string_value(pb, keyType, id.c_str(), valueType, path.c_str());
      if (rc) {
        QRTLog(kLogError, "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, %s: %s\n", rc, id.c_str(),
               what, path.c_str());
        return false;
      }
    }
    return true;
  };
  std::optional<QRTURL> temp;
  if (r.dataContainer) temp = r.dataContainer->URLByAppendingPathComponent("tmp", true);
  return packPath(QK_KERN_REPLY_HOME_DIR, r.home) && packPath(QK_KERN_REPLY_DATA_CONTAINER, r.dataContainer) &&
         packPath(QK_KERN_REPLY_TEMP_DIR, temp) &&
         packPairs(r.groups, QK_KERN_REPLY_GROUP_ID, QK_KERN_REPLY_GROUP_PATH, "group container") &&
         packPath(QK_KERN_REPLY_SYSTEM_CONTAINER, r.systemContainer) &&
         packPairs(r.systemGroups, QK_KERN_REPLY_SYSTEM_GROUP_ID, QK_KERN_REPLY_SYSTEM_GROUP_PATH,
                   "system group container");
}

}  // namespace

int32_t server_get_process_containers(const uint8_t* request, size_t requestSize, pid_t senderPid,
                                      std::vector<uint8_t>* reply) {
  if (senderPid != 0) {
    QRTLog(kLogError, "Refusing an upcall from pid %d: only the kernel may ask", static_cast<int>(senderPid));
    return 5;
  }
  QRTLog(kLogDebug, "request size: %u (%p)", static_cast<unsigned>(requestSize), static_cast<const void*>(request));
  // The reader never writes through the buffer. An empty region may come
  // without an address; it is still read, and refused, as a buffer.
  static uint8_t none[1];
  sb_packbuff* in = sb_packbuff_init_with_buffer(request ? const_cast<uint8_t*>(request) : none, requestSize, true,
                                                 SB_PACKBUFF_DEALLOC_NONE);
  if (!in) {
    QRTLog(kLogError, "sb_packbuff_init() of request data fails");
    return 9;
  }
  QRTLog(kLogDebug, "request packbuff byte address:%p", sb_packbuff_get_bytes(in));
  KernRequest req;
  int32_t code = readRequest(in, &req);
  sb_packbuff_free(in);
  if (code) return code;

  sb_packbuff* out = sb_packbuff_new(4096);
  if (!out) return 9;
  const std::optional<std::string>& identifier = req.containerId ? req.containerId : req.codeSignatureId;
  QRTClientConnection& internal = QRTClientConnection::sharedClientConnection();
  // Set once at start-up; written here only if that was skipped, never back.
  if (!internal.allowOtherIdLookup()) internal.setAllowOtherIdLookup(true);
  if (!internal.allowGroupIdLookup()) internal.setAllowGroupIdLookup(true);

  Resolved resolved;
  bool status = resolveContainers(req, identifier, &resolved);
  if (status) {
    resolved.home = homeDirectory(req.personaId);
    status = resolved.home.has_value();
  }
  if (status) {
    std::optional<QRTURL> temp;
    if (resolved.dataContainer) temp = resolved.dataContainer->URLByAppendingPathComponent("tmp", true);
    QRTLog(kLogDebug, "UPCALL-Containers for %@(%u):", identifier, req.personaId);
    QRTLog(kLogDebug, "dataContainerURL: %@", resolved.dataContainer);
    QRTLog(kLogDebug, "tempContainerURL: %@", temp);
    QRTLog(kLogDebug, "homeDirURL: %@", resolved.home);
    QRTLog(kLogDebug, "groupURLs: %@", describeGroups(resolved.groups));
    QRTLog(kLogDebug, "systemContainerURL: %@", resolved.systemContainer);
    QRTLog(kLogDebug, "systemGroupURLs: %@", describeGroups(resolved.systemGroups));
    status = packAnswer(out, resolved);
  }
  if (int rc = sb_packbuff_pack_uint32(out, QK_KERN_REPLY_STATUS, status ? 1 : 0)) {
    QRTLog(kLogError, "sb_packbuff_pack_uint32() fails: %d; type: %u, value: %u\n", rc, unsigned{QK_KERN_REPLY_STATUS},
           status ? 1u : 0u);
  }
  const uint8_t* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(out));
  reply->assign(bytes, bytes + sb_packbuff_get_size(out));
  QRTLog(kLogDebug, "packbuff bytes: %p, reply bytes: %p, reply size: %u", static_cast<const void*>(bytes),
         static_cast<const void*>(reply->data()), static_cast<unsigned>(reply->size()));
  sb_packbuff_free(out);
  return 0;
}

QRTKernVerdict QRTKernCheckRequest(const platform::UpcallMessage& request, int32_t* returnCode) {
  *returnCode = 0;
  if (request.id / 2 != QRTKernServerIdBase) return QRTKernVerdict::NotOurs;
  if (request.id != QRTKernServerRoutineId) {
    *returnCode = -303;
  } else if (!(request.bits & kComplexBit) || request.descriptorCount != 1) {
    *returnCode = -304;
  } else if (request.descriptorType != kOutOfLineDescriptor || request.requestSize != request.regionSize ||
             request.region.size() != request.regionSize) {
    *returnCode = -300;
  } else if (!request.credentialsValid) {
    *returnCode = -309;
  }
  return *returnCode ? QRTKernVerdict::Answer : QRTKernVerdict::Serve;
}

bool demux_server(const platform::UpcallMessage& request, platform::UpcallReply* reply) {
  QRTLog(kLogDebug, "in demux_server(); request->msgh_id: %d", static_cast<int>(request.id));
  int32_t code = 0;
  QRTKernVerdict verdict = QRTKernCheckRequest(request, &code);
  if (verdict == QRTKernVerdict::NotOurs) return false;
  QRTMetrics::Timer timed(QRTMetrics::upcalls(), &code);
  QRTLog(kLogDebug, "handling incomming request for quarter server");
  reply->id = request.id + QRTKernServerReplyIdOffset;
  reply->data.clear();
  if (verdict == QRTKernVerdict::Serve) {
    try {
      code = server_get_process_containers(request.region.data(), request.region.size(), request.pid, &reply->data);
    } catch (const std::exception& e) {
      // The kernel gets an answer whatever happened; the daemon goes on.
      QRTLog(kLogError, "Got exception: %s", e.what());
      code = 9;
    }
  }
  reply->returnCode = code;
  if (code != 0) reply->data.clear();
  QRTLog(kLogDebug, "quarter server returns: %d", static_cast<int>(code));
  return true;
}
