// The protection-class walk of a data container change against a floor that
// walks the same tree with openat/fsetxattr and nothing else: 20,000 files
// in 100 directories on the work disk. Each round flips every item between
// classes 3 and 4, so that every item is really written.
// Usage: bench_protection [scratch-parent [directories files-per-directory]]
// (default /var/tmp, 100 x 200; the parent must carry trusted attributes, so
// run as root on a disk file system)
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <vector>

#include "bench/BenchTree.h"
#include "Daemon/dataprotection/QRTDataProtectionChangeOperation.h"
#include "platform/Log.h"

namespace {

int gDirectories = 100;
int gFilesPerDirectory = 200;
constexpr int kRounds = 5;
constexpr const char* kAttribute = "trusted.com.norvane.protection-class";

bool setClass(int fd, int32_t cls) {
  const auto v = static_cast<uint32_t>(cls);
  const uint8_t b[4] = {uint8_t(v), uint8_t(v >> 8), uint8_t(v >> 16), uint8_t(v >> 24)};
  return fsetxattr(fd, kAttribute, b, sizeof b, 0) == 0;
}

// The floor: one openat and one fsetxattr per item, directories after their
// contents, no checks at all.
void floorWalk(int parent, const char* name, int32_t cls) {
  int fd = openat(parent, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) std::perror(name), std::exit(1);
  DIR* dir = fdopendir(dup(fd));
  while (dirent* entry = readdir(dir)) {
    if (entry->d_name[0] == '.') continue;
    if (entry->d_type == DT_DIR) {
      floorWalk(fd, entry->d_name, cls);
    } else if (entry->d_type == DT_REG) {
      int file = openat(fd, entry->d_name, O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
      if (file < 0 || !setClass(file, cls)) std::perror(entry->d_name), std::exit(1);
      close(file);
    }
  }
  closedir(dir);
  if (!setClass(fd, cls)) std::perror(name), std::exit(1);
  close(fd);
}

void ourWalk(const std::string& root, int32_t cls) {
  using Op = QRTDataProtectionChangeOperation;
  QRTErrorRef error;
  bool locked = false;
  if (!Op::setProtectionClassOfTreeAtURL(QRTURL::fileURL(root, true), cls,
                                         Op::QRTChangeDirectories | Op::QRTChangeFiles, &locked, &error) ||
      locked)
    std::fprintf(stderr, "failed: %s\n", error ? error->description().c_str() : "locked"), std::exit(1);
}

}  // namespace

int main(int argc, char** argv) {
  const std::string parent = argc > 1 ? argv[1] : "/var/tmp";
  if (argc > 3) gDirectories = std::atoi(argv[2]), gFilesPerDirectory = std::atoi(argv[3]);
  std::string scratchTemplate = parent + "/qrt-bench-protection.XXXXXX";
  if (!mkdtemp(scratchTemplate.data())) return std::perror("mkdtemp"), 1;
  const std::string scratch = scratchTemplate;
  // Debug lines off: one per item would otherwise go to the system log.
  platform::logOpen(scratch + "/bench.log", "com.norvane.quarterd", platform::kLogNotice);

  const std::string ours = scratch + "/ours", theirs = scratch + "/floor";
  bench::buildTree(ours, gDirectories, gFilesPerDirectory, 0);
  bench::buildTree(theirs, gDirectories, gFilesPerDirectory, 0);
  std::vector<double> ourTimes, floorTimes;
  for (int round = 0; round < kRounds; ++round) {
    const int32_t cls = round % 2 ? 4 : 3;
    auto a = [&] { ourTimes.push_back(bench::timed([&] { ourWalk(ours, cls); })); };
    auto b = [&] { floorTimes.push_back(bench::timed([&] { floorWalk(AT_FDCWD, theirs.c_str(), cls); })); };
    if (round % 2)
      a(), b();
    else
      b(), a();
    std::printf("round %d: protection walk %.3f s, openat/fsetxattr floor %.3f s\n", round + 1, ourTimes.back(),
                floorTimes.back());
  }
  if (std::system(("rm -rf '" + scratch + "'").c_str()) != 0)
    std::fprintf(stderr, "cannot remove %s\n", scratch.c_str());

  const double a = bench::median(ourTimes), b = bench::median(floorTimes);
  std::printf("\n%d files in %d directories, median of %d rounds\n\n", gDirectories * gFilesPerDirectory, gDirectories,
              kRounds);
  std::printf("%-34s %9.3f s\n%-34s %9.3f s\n%-34s %9.3f (target <= 1.2)\n", "protection walk", a,
              "openat/fsetxattr floor", b, "ratio (ours / floor)", a / b);
  return 0;
}
