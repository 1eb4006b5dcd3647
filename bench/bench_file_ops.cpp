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

#include "Daemon/fileops/QRTFileManager.h"

namespace {

int gDirectories = 100;
int gFilesPerDirectory = 200;
constexpr size_t kFileSize = 100;
constexpr int kRounds = 3;

void buildTree(const std::string& root) {
  const std::string content(kFileSize, 'x');
  if (mkdir(root.c_str(), 0755) != 0) std::perror(root.c_str()), std::exit(1);
  for (int d = 0; d < gDirectories; ++d) {
    std::string dir = root + "/dir" + std::to_string(d);
    mkdir(dir.c_str(), 0755);
    for (int f = 0; f < gFilesPerDirectory; ++f) {
      std::string file = dir + "/file" + std::to_string(f);
      int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
      if (fd < 0 || write(fd, content.data(), content.size()) != static_cast<ssize_t>(content.size()))
        std::perror(file.c_str()), std::exit(1);
      close(fd);
    }
  }
}

// Written-back pages of the trees just built, and the discards of earlier
// removals (the disk is mounted with online discard), would otherwise land
// on whichever run comes next.
void settle() {
  sync();
  sleep(3);
  sync();
}

double timed(const std::function<void()>& work) {
  settle();
  auto start = std::chrono::steady_clock::now();
  work();
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

void shell(const std::string& command) {
  if (std::system(command.c_str()) != 0) std::fprintf(stderr, "failed: %s\n", command.c_str()), std::exit(1);
}

void mustSucceed(bool ok, const QRTErrorRef& error) {
  if (!ok) std::fprintf(stderr, "failed: %s\n", error ? error->description().c_str() : "?"), std::exit(1);
}

double median(std::vector<double> v) {
  std::sort(v.begin(), v.end());
  return v[v.size() / 2];
}

void report(const char* ours, const std::vector<double>& a, const char* theirs, const std::vector<double>& b) {
  double ma = median(a), mb = median(b);
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
  buildTree(source);
  for (int round = 0; round < kRounds; ++round) {
    const QRTURL to = QRTURL::fileURL(scratch + "/ours" + std::to_string(round));
    const std::string cpTo = scratch + "/cp" + std::to_string(round);
    pair(
        round,
        [&] { ourCopy.push_back(timed([&] { mustSucceed(fm._copyItemAtURL(QRTURL::fileURL(source), to, true, &error), error); })); },
        [&] { cpA.push_back(timed([&] { shell("cp -a '" + source + "' '" + cpTo + "'"); })); });
    std::printf("round %d: copy %.3f s, cp -a %.3f s\n", round + 1, ourCopy.back(), cpA.back());
  }
  shell("rm -rf '" + scratch + "'/*");

  std::vector<double> ourRemove, rmRf;
  for (int round = 0; round < kRounds; ++round) {
    const std::string a = scratch + "/a", b = scratch + "/b";
    buildTree(a);
    buildTree(b);
    pair(
        round,
        [&] { ourRemove.push_back(timed([&] { mustSucceed(fm.removeItemAtURL(QRTURL::fileURL(a), &error), error); })); },
        [&] { rmRf.push_back(timed([&] { shell("rm -rf '" + b + "'"); })); });
    std::printf("round %d: remove %.3f s, rm -rf %.3f s\n", round + 1, ourRemove.back(), rmRf.back());
  }
  shell("rm -rf '" + scratch + "'");

  std::printf("\n%d files of %zu bytes in %d directories, median of %d rounds\n\n",
              gDirectories * gFilesPerDirectory, kFileSize, gDirectories, kRounds);
  report("QRTFileManager _copyItemAtURL", ourCopy, "cp -a", cpA);
  report("QRTFileManager removeItemAtURL", ourRemove, "rm -rf", rmRf);
  return 0;
}
