#include "Daemon/requests/QRTVerifyCommand.h"

#include "Daemon/QRTProcessWide.h"
#include "Daemon/verify/QRTVerify.h"
#include "platform/Log.h"
#include "platform/Queue.h"

namespace {

platform::Queue& verifyQueue() {
  static std::shared_ptr<platform::Queue> queue = platform::makeSerialQueue("com.norvane.quarterd.verify");
  return *queue;
}

plist::Array findingsPlist(const std::vector<QRTFinding>& findings) {
  plist::Array out;
  out.reserve(findings.size());
  for (const QRTFinding& finding : findings) {
    plist::Dictionary entry;
    entry[QRTFindingKeyKind] = finding.kind;
    entry[QRTFindingKeySeverity] = QRTFindingSeverityName(finding.severity);
    entry[QRTFindingKeySubject] = finding.subject;
    entry[QRTFindingKeyDetail] = finding.detail;
    entry[QRTFindingKeyAction] = finding.action;
    entry[QRTFindingKeyRepaired] = finding.repaired;
    out.emplace_back(std::move(entry));
  }
  return out;
}

}  // namespace

void QRTHandleVerify(const plist::Dictionary& request, const QRTReplyRef& reply, QRTClientConnection&, uint64_t*) {
  const bool repair = QRTMessageBool(request, QRTKeyRepair);
  run_async_with_transaction(verifyQueue(), [reply, repair] {
    uint64_t result = QRTErrorNone;
    try {
      QRTVerifyReport report = QRTVerifyStore(repair);
      reply->dictionary[QRTReplyKeyVerifiedContainers] = report.containers;
      reply->dictionary[QRTReplyKeyFindings] = findingsPlist(report.findings);
    } catch (...) { result = QRT_EXCEPTION_ERROR()->resultCode(); }
    reply->send(result);
  });
}
