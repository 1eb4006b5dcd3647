// What the daemon counts about its own work, cheap enough to stay on: per
// command the requests served and failed with their latency, and the same
// for kernel upcalls. Counting is lock-free (relaxed atomics); readers take a
// snapshot, which may be a few counts apart between fields but never tears one.
#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>

// Latency in fixed buckets: bucket 0 holds what took under 1 µs, bucket i
// (1 to kBuckets - 2) what took [2^(i-1), 2^i) µs, the last everything longer.
class QRTLatencyHistogram {
 public:
  static constexpr size_t kBuckets = 32;
  static constexpr uint64_t bucketUpperMicros(size_t i) { return uint64_t{1} << i; }
  static size_t bucketFor(uint64_t micros);

  struct Snapshot {
    uint64_t served = 0;
    uint64_t failed = 0;
    uint64_t sumMicros = 0;
    std::array<uint64_t, kBuckets> buckets{};
    // The q-quantile (0 to 1) in µs, interpolated inside its bucket; 0 when empty.
    uint64_t quantileMicros(double q) const;
    void add(const Snapshot& other);
  };

  void record(uint64_t micros, bool failed) {
    served_.fetch_add(1, std::memory_order_relaxed);
    if (failed) failed_.fetch_add(1, std::memory_order_relaxed);
    sum_.fetch_add(micros, std::memory_order_relaxed);
    buckets_[bucketFor(micros)].fetch_add(1, std::memory_order_relaxed);
  }
  Snapshot snapshot() const;

 private:
  std::atomic<uint64_t> served_{0}, failed_{0}, sum_{0};
  std::array<std::atomic<uint64_t>, kBuckets> buckets_{};
};

namespace QRTMetrics {

// Slots: the main command table, then the administrative commands from 100,
// then one for every other command number.
inline constexpr size_t kExtensionSlots = 16;
inline constexpr size_t kSlots = 30 + kExtensionSlots + 1;
size_t slotForCommand(uint64_t command);
// The command a slot counts; UINT64_MAX for the slot of the others.
uint64_t commandForSlot(size_t slot);

QRTLatencyHistogram& requests(size_t slot);
QRTLatencyHistogram& upcalls();

// When the daemon started counting (the first call, made early at start-up).
std::chrono::steady_clock::time_point startTime();

using Clock = std::chrono::steady_clock;
inline uint64_t microsSince(Clock::time_point start) {
  return static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::microseconds>(Clock::now() - start).count());
}

// Times a scope into a histogram; failed when *code is not 0 at its end.
class Timer {
 public:
  Timer(QRTLatencyHistogram& histogram, const int32_t* code)
      : histogram_(histogram), code_(code), start_(Clock::now()) {}
  ~Timer() { histogram_.record(microsSince(start_), *code_ != 0); }
  Timer(const Timer&) = delete;
  Timer& operator=(const Timer&) = delete;

 private:
  QRTLatencyHistogram& histogram_;
  const int32_t* code_;
  Clock::time_point start_;
};

}  // namespace QRTMetrics
