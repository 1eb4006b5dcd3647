#include "Daemon/QRTMetrics.h"

#include <algorithm>
#include <bit>

#include "base/QRTProtocol.h"

static_assert(QRTCommandCount == 30, "the metrics slots follow the command table");

size_t QRTLatencyHistogram::bucketFor(uint64_t micros) {
  return std::min<size_t>(static_cast<size_t>(std::bit_width(micros)), kBuckets - 1);
}

QRTLatencyHistogram::Snapshot QRTLatencyHistogram::snapshot() const {
  Snapshot s;
  s.served = served_.load(std::memory_order_relaxed);
  s.failed = failed_.load(std::memory_order_relaxed);
  s.sumMicros = sum_.load(std::memory_order_relaxed);
  for (size_t i = 0; i < kBuckets; ++i) s.buckets[i] = buckets_[i].load(std::memory_order_relaxed);
  return s;
}

void QRTLatencyHistogram::Snapshot::add(const Snapshot& other) {
  served += other.served;
  failed += other.failed;
  sumMicros += other.sumMicros;
  for (size_t i = 0; i < kBuckets; ++i) buckets[i] += other.buckets[i];
}

uint64_t QRTLatencyHistogram::Snapshot::quantileMicros(double q) const {
  uint64_t total = 0;
  for (uint64_t n : buckets) total += n;
  if (total == 0) return 0;
  // The rank of the wanted sample, 1 to total.
  const double rank = std::max(1.0, q * static_cast<double>(total));
  uint64_t below = 0;
  for (size_t i = 0; i < kBuckets; ++i) {
    if (buckets[i] == 0 || static_cast<double>(below + buckets[i]) < rank) {
      below += buckets[i];
      continue;
    }
    const double low = i == 0 ? 0.0 : static_cast<double>(bucketUpperMicros(i - 1));
    const double high = static_cast<double>(bucketUpperMicros(i));
    const double within = (rank - static_cast<double>(below)) / static_cast<double>(buckets[i]);
    return static_cast<uint64_t>(low + (high - low) * within);
  }
  return bucketUpperMicros(kBuckets - 1);
}

namespace QRTMetrics {

namespace {
std::array<QRTLatencyHistogram, kSlots>& slots() {
  static auto* all = new std::array<QRTLatencyHistogram, kSlots>();  // request threads may outlive static destruction
  return *all;
}
}  // namespace

size_t slotForCommand(uint64_t command) {
  if (command < QRTCommandCount) return static_cast<size_t>(command);
  if (command >= QRTCommandFirstExtension && command - QRTCommandFirstExtension < kExtensionSlots)
    return QRTCommandCount + static_cast<size_t>(command - QRTCommandFirstExtension);
  return kSlots - 1;
}

uint64_t commandForSlot(size_t slot) {
  if (slot < QRTCommandCount) return slot;
  if (slot < kSlots - 1) return QRTCommandFirstExtension + (slot - QRTCommandCount);
  return UINT64_MAX;
}

QRTLatencyHistogram& requests(size_t slot) { return slots()[slot < kSlots ? slot : kSlots - 1]; }

QRTLatencyHistogram& upcalls() {
  static auto* histogram = new QRTLatencyHistogram();
  return *histogram;
}

std::chrono::steady_clock::time_point startTime() {
  static const auto start = Clock::now();
  return start;
}

}  // namespace QRTMetrics
