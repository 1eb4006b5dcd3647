// Recursive removal and copy of QRTFileManager against rm -rf and cp -a on the
// same trees: 20,000 files of 100 bytes in 100 directories on the work disk.
// Usage: bench_file_ops [scratch-parent [directories files-per-directory]]
// (default /var/tmp, 100 x 200; the parent must not be a tmpfs)
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <vector>

#include "bench/BenchTree.h"
#include "Daemon/fileops/QRTFileManager.h"

namespace {

int gDirectories = 100;
int gFilesPerDirectory = 200;
constexpr size_t kFileSize = 100;
constexpr int kRounds = 3;

void shell(const std::string& command) {
  if (std::system(command.c_str()) != 0) std::fprintf(stderr, "failed: %s\n", command.c_str()), std::exit(1);
}

void mustSucceed(bool ok, const QRTErrorRef& error) {
  if (!ok) std::fprintf(stderr, "failed: %s\n", error ? error->description().c_str() : "?"), std::exit(1);
}

void report(const char* ours, const std::vector<double>& a, const char* theirs, const std::vector<double>& b) {
  double ma = bench::median(a), mb = bench::median(b);
  std::printf("%-34s %9.3f s\n%-34s %9.3f s\n%-34s %9.3f\n\n", ours, ma, theirs, mb, "ratio (ours / theirs)", ma / mb);
}

// Runs both in alternating order, so that neither always goes first.
void pair(int round, const std::function<void()>& ours, const std::function<void()>& theirs) {
  if (round % 2 == 0) {
    ours();
    theirs();
  } else {
    theirs();
    ours();
  }
}

}  // namespace

int main(int argc, char** argv) {
  const std::string parent = argc > 1 ? argv[1] : "/var/tmp";
  if (argc > 3) gDirectories = std::atoi(argv[2]), gFilesPerDirectory = std::atoi(argv[3]);
  std::string scratchTemplate = parent + "/qrt-bench-file-ops.XXXXXX";
  if (!mkdtemp(scratchTemplate.data())) return std::perror("mkdtemp"), 1;
  const std::string scratch = scratchTemplate;
  QRTFileManager& fm = QRTFileManager::defaultManager();
  QRTErrorRef error;

  // Copies first, all kept until the end, so that no removal runs between them.
  std::vector<double> ourCopy, cpA;
  const std::string source = scratch + "/source";
  bench::buildTree(source, gDirectories, gFilesPerDirectory, kFileSize);
  for (int round = 0; round < kRounds; ++round) {
    const QRTURL to = QRTURL::fileURL(scratch + "/ours" + std::to_string(round));
    const std::string cpTo = scratch + "/cp" + std::to_string(round);
    pair(
        round,
        [&] {
          ourCopy.push_back(
              bench::timed([&] { mustSucceed(fm._copyItemAtURL(QRTURL::fileURL(source), to, true, &error), error); }));
        },
        [&] { cpA.push_back(bench::timed([&] { shell("cp -a '" + source + "' '" + cpTo + "'"); })); });
    std::printf("round %d: copy %.3f s, cp -a %.3f s\n", round + 1, ourCopy.back(), cpA.back());
  }
  shell("rm -rf '" + scratch + "'/*");

  std::vector<double> ourRemove, rmRf;
  for (int round = 0; round < kRounds; ++round) {
    const std::string a = scratch + "/a", b = scratch + "/b";
    bench::buildTree(a, gDirectories, gFilesPerDirectory, kFileSize);
    bench::buildTree(b, gDirectories, gFilesPerDirectory, kFileSize);
    pair(
        round,
        [&] {
          ourRemove.push_back(
              bench::timed([&] { mustSucceed(fm.removeItemAtURL(QRTURL::fileURL(a), &error), error); }));
        },
        [&] { rmRf.push_back(bench::timed([&] { shell("rm -rf '" + b + "'"); })); });
    std::printf("round %d: remove %.3f s, rm -rf %.3f s\n", round + 1, ourRemove.back(), rmRf.back());
  }
  shell("rm -rf '" + scratch + "'");

  std::printf("\n%d files of %zu bytes in %d directories, median of %d rounds\n\n", gDirectories * gFilesPerDirectory,
              kFileSize, gDirectories, kRounds);
  report("QRTFileManager _copyItemAtURL", ourCopy, "cp -a", cpA);
  report("QRTFileManager removeItemAtURL", ourRemove, "rm -rf", rmRf);
  return 0;
}
