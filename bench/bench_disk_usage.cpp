// QRTFileManager::diskUsageForURL against `du -s` on the same tree, cache
// warm: 100,000 files of 100 bytes in 1,000 directories on the work disk.
// Usage: bench_disk_usage [scratch-parent] (default /var/tmp; not a tmpfs)
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cinttypes>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include "Daemon/fileops/QRTFileManager.h"
#include "platform/Log.h"

namespace {

constexpr int kGroups = 10;
constexpr int kDirectoriesPerGroup = 100;
constexpr int kFilesPerDirectory = 100;
constexpr size_t kFileSize = 100;
constexpr int kRounds = 5;

[[noreturn]] void fail(const std::string& what) {
  std::perror(what.c_str());
  std::exit(1);
}

uint64_t allocatedBytes(const std::string& path) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) fail(path);
  return static_cast<uint64_t>(st.st_blocks) * 512;
}

void makeDirectory(const std::string& path) {
  if (mkdir(path.c_str(), 0755) != 0) fail(path);
}

// Returns the allocation of the directories themselves, which du counts and
// the daemon does not.
uint64_t buildTree(const std::string& root) {
  const std::string content(kFileSize, 'x');
  std::vector<std::string> directories{root};
  makeDirectory(root);
  for (int g = 0; g < kGroups; ++g) {
    std::string group = root + "/group" + std::to_string(g);
    makeDirectory(group);
    directories.push_back(group);
    for (int d = 0; d < kDirectoriesPerGroup; ++d) {
      std::string dir = group + "/dir" + std::to_string(d);
      makeDirectory(dir);
      directories.push_back(dir);
      for (int f = 0; f < kFilesPerDirectory; ++f) {
        std::string file = dir + "/file" + std::to_string(f);
        int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        if (fd < 0 || write(fd, content.data(), content.size()) != static_cast<ssize_t>(content.size())) fail(file);
        close(fd);
      }
    }
  }
  sync();  // allocation is settled only once delayed allocation has run
  uint64_t directoryBytes = 0;
  for (const std::string& dir : directories) directoryBytes += allocatedBytes(dir);
  return directoryBytes;
}

uint64_t duTotal(const std::string& root) {
  std::string command = "du -s --block-size=1 '" + root + "'";
  FILE* pipe = popen(command.c_str(), "r");
  if (!pipe) fail("popen");
  unsigned long long total = 0;
  if (std::fscanf(pipe, "%llu", &total) != 1) total = 0;
  if (pclose(pipe) != 0) fail(command);
  return total;
}

struct Sample {
  double wall = 0;
  double cpu = 0;  // user and system time, the helper thread's included
};

double cpuSeconds(int who) {
  rusage usage{};
  getrusage(who, &usage);
  auto seconds = [](const timeval& t) { return static_cast<double>(t.tv_sec) + t.tv_usec / 1e6; };
  return seconds(usage.ru_utime) + seconds(usage.ru_stime);
}

// CPU time is reported beside wall time because the machine is shared:
// other load moves the wall times of both sides a lot.
Sample measure(int who, const std::function<void()>& work) {
  const double cpuBefore = cpuSeconds(who);
  auto start = std::chrono::steady_clock::now();
  work();
  Sample sample;
  sample.wall = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  sample.cpu = cpuSeconds(who) - cpuBefore;
  return sample;
}

double median(const std::vector<Sample>& samples, double Sample::*field) {
  std::vector<double> v;
  for (const Sample& s : samples) v.push_back(s.*field);
  std::sort(v.begin(), v.end());
  return v[v.size() / 2];
}

}  // namespace

int main(int argc, char** argv) {
  platform::logSetLevel(platform::kLogError);
  std::string parent = argc > 1 ? argv[1] : "/var/tmp";
  std::string scratch = parent + "/qrt-bench-du.XXXXXX";
  if (!mkdtemp(scratch.data())) fail(scratch);
  const std::string root = scratch + "/tree";
  std::printf("building %d files in %d directories under %s\n", kGroups * kDirectoriesPerGroup * kFilesPerDirectory,
              kGroups * kDirectoriesPerGroup, root.c_str());
  const uint64_t directoryBytes = buildTree(root);
  const QRTURL url = QRTURL::fileURL(root, true);
  QRTFileManager& files = QRTFileManager::defaultManager();

  duTotal(root);  // warms the dentry and inode caches
  uint64_t theirs = 0, ours = 0;
  std::vector<Sample> duSamples, ourSamples;
  for (int round = 0; round < kRounds; ++round) {
    duSamples.push_back(measure(RUSAGE_CHILDREN, [&] { theirs = duTotal(root); }));
    ourSamples.push_back(measure(RUSAGE_SELF, [&] { ours = files.diskUsageForURL(url); }));
    std::printf("round %d: du -s %.4f s, diskUsageForURL %.4f s\n", round + 1, duSamples.back().wall,
                ourSamples.back().wall);
  }

  const double du = median(duSamples, &Sample::wall), mine = median(ourSamples, &Sample::wall);
  const double duCpu = median(duSamples, &Sample::cpu), myCpu = median(ourSamples, &Sample::cpu);
  std::printf("\nmedian of %d rounds        %12s %12s\n", kRounds, "wall (s)", "cpu (s)");
  std::printf("%-26s %12.4f %12.4f\n", "du -s", du, duCpu);
  std::printf("%-26s %12.4f %12.4f\n", "diskUsageForURL", mine, myCpu);
  std::printf("%-26s %12.3f %12.3f\n\n", "ratio (ours / du -s)", mine / du, myCpu / duCpu);
  // du also counts the directories; the daemon counts only what is in them.
  const uint64_t expected = theirs - directoryBytes;
  std::printf("du -s --block-size=1: %" PRIu64 " (of which directories %" PRIu64 ")\ndiskUsageForURL:      %" PRIu64
              "\n",
              theirs, directoryBytes, ours);
  if (ours == expected) {
    std::printf("totals agree (du minus directories == diskUsageForURL)\n");
  } else {
    std::printf("TOTALS DIFFER: du minus directories %" PRIu64 ", diskUsageForURL %" PRIu64 ", difference %" PRId64
                "\n",
                expected, ours, static_cast<int64_t>(ours - expected));
  }

  std::error_code ec;
  std::filesystem::remove_all(scratch, ec);
  return ours == expected ? 0 : 1;
}
