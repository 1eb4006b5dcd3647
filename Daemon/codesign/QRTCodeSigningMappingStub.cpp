// Stands in for the code-signing mapping service until it is merged: no
// service, so every identifier reads as unmapped.
#include "Daemon/codesign/QRTCodeSigningMapping.h"

QRTCodeSigningMapping* QRTCodeSigningMapping::sharedInstance() { return nullptr; }

uint64_t QRTCodeSigningMapping::processCodeSigningInfo(const plist::Dictionary*, const std::optional<std::string>&,
                                                       const plist::Dictionary*) {
  return 1;
}
uint64_t QRTCodeSigningMapping::processCallerRegisteredEntitlements(const plist::Dictionary&, const std::string&) {
  return 1;
}
std::optional<plist::Dictionary> QRTCodeSigningMapping::getCodeSigningInfoForIdentifier(
    const std::optional<std::string>&) {
  return std::nullopt;
}
uint64_t QRTCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() { return 1; }
void QRTCodeSigningMapping::performAllCodeSigningMigrationAndReconciliation() {}
bool QRTCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string&, QRTErrorRef*) {
  return true;
}
void QRTCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string&) {}
bool QRTCodeSigningMapping::codeSigningInfoExistForIdentifier(const std::string&) { return false; }
bool QRTCodeSigningMapping::identifierHasCallerRegisteredEntitlements(const std::string&) { return false; }
bool QRTCodeSigningMapping::identifierHasSystemContainer(const std::string&) { return false; }
uint64_t QRTCodeSigningMapping::dataContainerTypeForIdentifier(const std::string&) { return 0; }
QRTGroupList QRTCodeSigningMapping::appGroupIdentifiersForIdentifier(const std::string&) { return std::nullopt; }
QRTGroupList QRTCodeSigningMapping::systemGroupIdentifiersForIdentifier(const std::string&) { return std::nullopt; }
void QRTCodeSigningMapping::iterateGroupIdsWithKey(
    const std::string&, const std::optional<std::string>&,
    const std::function<void(const std::string&, const QRTGroupList&)>&) {}
