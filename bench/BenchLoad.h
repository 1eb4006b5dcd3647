// Closed-loop load over sockets: one thread per client, each timing its own
// calls until a common deadline, and the throughput and percentiles of all.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <functional>
#include <thread>
#include <vector>

namespace bench {

using Clock = std::chrono::steady_clock;

struct LoadStats {
  double perSecond = 0, p50us = 0, p99us = 0;
  uint64_t calls = 0;
  uint64_t unexpected = 0;  // answers other than the expected one, or none
};

// What one client does until the deadline: push each call's nanoseconds and
// count the unexpected answers.
using ClientLoop =
    std::function<void(Clock::time_point deadline, std::vector<uint32_t>& latenciesNs, uint64_t& unexpected)>;

inline uint32_t nanosecondsSince(Clock::time_point start) {
  return static_cast<uint32_t>(std::min<int64_t>(
      std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now() - start).count(), UINT32_MAX));
}

inline LoadStats runLoad(int clients, double seconds, const ClientLoop& loop) {
  std::vector<std::vector<uint32_t>> latencies(clients);
  std::vector<uint64_t> unexpected(clients, 0);
  const auto begin = Clock::now();
  const auto deadline = begin + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
  std::vector<std::thread> threads;
  for (int i = 0; i < clients; ++i) threads.emplace_back([&, i] { loop(deadline, latencies[i], unexpected[i]); });
  for (auto& t : threads) t.join();
  const double elapsed = std::chrono::duration<double>(Clock::now() - begin).count();
  LoadStats stats;
  std::vector<uint32_t> all;
  for (int i = 0; i < clients; ++i) {
    all.insert(all.end(), latencies[i].begin(), latencies[i].end());
    stats.unexpected += unexpected[i];
  }
  if (all.empty()) return stats;
  std::sort(all.begin(), all.end());
  stats.calls = all.size();
  stats.perSecond = static_cast<double>(all.size()) / elapsed;
  stats.p50us = all[all.size() / 2] / 1000.0;
  stats.p99us = all[std::min(all.size() - 1, all.size() * 99 / 100)] / 1000.0;
  return stats;
}

}  // namespace bench
