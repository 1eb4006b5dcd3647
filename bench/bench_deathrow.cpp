// One death-row pass of the daemon against `rm -rf` of the same tree: 20,000
// files of 100 bytes in 100 directories on the work disk, median of 3 rounds.
// Usage: bench_deathrow [scratch-parent] (default /var/tmp; not a tmpfs)
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <future>
#include <string>
#include <vector>

#include "bench/BenchTree.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/fileops/QRTFileManager.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace {

constexpr int kDirectories = 100;
constexpr int kFilesPerDirectory = 200;
constexpr size_t kFileSize = 100;
constexpr int kRounds = 3;

[[noreturn]] void fail(const std::string& what) {
  std::fprintf(stderr, "failed: %s\n", what.c_str());
  std::exit(1);
}

void deathRowPass() {
  std::promise<uint64_t> done;
  std::future<uint64_t> result = done.get_future();
  QRTClientConnection::sharedClientConnection().deleteContainersOnDeathRowWithCompletion(
      [&done](uint64_t code) { done.set_value(code); });
  if (uint64_t code = result.get(); code != QRTErrorNone) fail("death-row pass returned " + std::to_string(code));
}

}  // namespace

int main(int argc, char** argv) {
  const std::string parent = argc > 1 ? argv[1] : "/var/tmp";
  std::string scratch = parent + "/qrt-bench-deathrow.XXXXXX";
  if (!mkdtemp(scratch.data())) fail("mkdtemp in " + parent);
  const std::string deviceRoot = scratch + "/root";
  if (mkdir(deviceRoot.c_str(), 0755) != 0) fail("mkdir " + deviceRoot);
  platform::setDeviceRoot(deviceRoot);  // before the configuration computes any path
  platform::logOpen(scratch + "/quarterd.log", "bench_deathrow", platform::kLogNotice);
  const std::string deathRow = QRTGlobalConfiguration::sharedInstance().deathrowDirectory().path();

  std::vector<double> pass, rmRf;
  for (int round = 0; round < kRounds; ++round) {
    // Laid out as staging leaves it: a holding directory with the container inside.
    const std::string holding = deathRow + "/temp.bench" + std::to_string(round);
    if (mkdir(holding.c_str(), 0755) != 0) fail("mkdir " + holding);
    bench::buildTree(holding + "/container", kDirectories, kFilesPerDirectory, kFileSize);
    const std::string other = scratch + "/rm" + std::to_string(round);
    bench::buildTree(other, kDirectories, kFilesPerDirectory, kFileSize);
    auto ours = [&] { pass.push_back(bench::timed(deathRowPass)); };
    auto theirs = [&] {
      rmRf.push_back(bench::timed([&] {
        if (std::system(("rm -rf '" + other + "'").c_str()) != 0) fail("rm -rf " + other);
      }));
    };
    if (round % 2 == 0) {
      ours();
      theirs();
    } else {
      theirs();
      ours();
    }
    auto left = QRTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(QRTURL::fileURL(deathRow, true), nullptr);
    if (!left || !left->empty()) fail("death row not empty after the pass");
    std::printf("round %d: death-row pass %.3f s, rm -rf %.3f s\n", round + 1, pass.back(), rmRf.back());
  }

  const double ourMedian = bench::median(pass), rmMedian = bench::median(rmRf);
  std::printf("\n%d files of %zu bytes in %d directories, median of %d rounds\n\n", kDirectories * kFilesPerDirectory,
              kFileSize, kDirectories, kRounds);
  std::printf("%-30s %10s\n", "operation", "seconds");
  std::printf("%-30s %10.3f\n", "death-row pass", ourMedian);
  std::printf("%-30s %10.3f\n", "rm -rf", rmMedian);
  std::printf("%-30s %10.3f\n", "ratio (pass / rm -rf)", ourMedian / rmMedian);

  platform::logClose();
  if (std::system(("rm -rf '" + scratch + "'").c_str()) != 0) fail("rm -rf " + scratch);
  return 0;
}
