// Deletion that yields: the create p99 of one client while a death-row pass
// removes 100,000 files, against the same client with nothing else running,
// and against the same files removed by rm -rf at normal priority.
// Usage: bench_deathrow_yield [files (default 100000)] [scratch-parent (default /var/tmp)]
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace {

using Clock = std::chrono::steady_clock;
constexpr uint32_t kUsers = 40;
constexpr size_t kPerUser = 9000;

[[noreturn]] void fail(const std::string& what) {
  std::fprintf(stderr, "failed: %s\n", what.c_str());
  std::exit(1);
}

void check(bool ok, const std::string& what) {
  if (!ok) fail(what);
}

std::string makeRoot(const std::string& parent) {
  std::string tmpl = parent + "/qrt-bench-yield.XXXXXX";
  check(mkdtemp(tmpl.data()) != nullptr, "mkdtemp");
  check(system(("mkdir -p " + tmpl + "/etc " + tmpl + "/private/var/mobile").c_str()) == 0, "root dirs");
  std::ofstream passwd(tmpl + "/etc/passwd");
  passwd << "root:x:0:0::/private/var/root:/bin/sh\nmobile:x:501:501::/private/var/mobile:/bin/sh\n";
  // A class holds at most 10,000 containers per user: the client moves on to the next user.
  for (uint32_t user = 502; user < 501 + kUsers; ++user) {
    const std::string home = "/private/var/u" + std::to_string(user);
    passwd << "u" << user << ":x:" << user << ":" << user << "::" << home << ":/bin/sh\n";
    check(mkdir((tmpl + home).c_str(), 0755) == 0, home);
  }
  return tmpl;
}

// files small files of 4 KiB, 1,000 to a directory, under dir.
void plant(const std::string& dir, int files) {
  check(mkdir(dir.c_str(), 0755) == 0, dir);
  const std::string block(4096, 'x');
  for (int i = 0; i < files; ++i) {
    const std::string sub = dir + "/d" + std::to_string(i / 1000);
    if (i % 1000 == 0) check(mkdir(sub.c_str(), 0755) == 0, sub);
    const std::string file = sub + "/f" + std::to_string(i);
    int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
    check(fd >= 0 && write(fd, block.data(), block.size()) == static_cast<ssize_t>(block.size()), file);
    close(fd);
  }
  sync();
}

struct Run {
  size_t creates = 0;
  double p50us = 0, p99us = 0;
};

// Creates containers one after another until done() says so (at least
// minimum of them), timing each.
Run createWhile(const std::string& prefix, size_t minimum, const std::function<bool()>& done) {
  QRTClientConnection& client = QRTClientConnection::sharedClientConnection();
  std::vector<double> micros;
  while (micros.size() < minimum || !done()) {
    const auto start = Clock::now();
    uint64_t code = 1;
    static size_t made = 0;
    const auto user = static_cast<uint32_t>(501 + made++ / kPerUser);
    check(user < 501 + kUsers, "more users");
    check(
        client.createOrLookupContainerForUser({user, 2, prefix + std::to_string(micros.size())},
                                              QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, &code) != nullptr,
        "create");
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  std::sort(micros.begin(), micros.end());
  return Run{micros.size(), micros[micros.size() / 2], micros[std::min(micros.size() - 1, micros.size() * 99 / 100)]};
}

void print(const char* what, const Run& run, const Run& quiet) {
  std::printf("%-40s %8zu %10.0f us %10.0f us %8.2f\n", what, run.creates, run.p50us, run.p99us,
              run.p99us / quiet.p99us);
}

}  // namespace

int main(int argc, char** argv) {
  const int files = argc > 1 ? std::atoi(argv[1]) : 100000;
  const std::string root = makeRoot(argc > 2 ? argv[2] : "/var/tmp");
  platform::setDeviceRoot(root);
  platform::logOpen("/dev/null", "bench", platform::kLogNotice);
  QRTClientConnection& client = QRTClientConnection::sharedClientConnection();
  const std::string deathRow = QRTGlobalConfiguration::sharedInstance().deathrowDirectory().path();
  check(system(("mkdir -p " + deathRow).c_str()) == 0, deathRow);
  constexpr size_t kMinimum = 400;

  createWhile("com.example.warm", 50, [] { return true; });
  // As long as a pass takes, so that both see the same share of outside noise.
  const auto quietEnd = Clock::now() + std::chrono::seconds(60);
  const Run quiet = createWhile("com.example.quiet", kMinimum, [&] { return Clock::now() >= quietEnd; });

  plant(root + "/doomed", files);
  std::atomic<bool> removed{false};
  std::thread rm([&] {
    std::system(("rm -rf " + root + "/doomed").c_str());
    removed = true;
  });
  const Run rmRun = createWhile("com.example.rm", kMinimum, [&] { return removed.load(); });
  rm.join();

  plant(deathRow + "/doomed", files);
  std::atomic<bool> passed{false};
  const auto passStart = Clock::now();
  double passSeconds = 0;
  client.deleteContainersOnDeathRowWithCompletion([&](uint64_t) {
    passSeconds = std::chrono::duration<double>(Clock::now() - passStart).count();
    passed = true;
  });
  const Run passRun = createWhile("com.example.pass", kMinimum, [&] { return passed.load(); });
  while (!passed) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  struct stat st;
  check(stat((deathRow + "/doomed").c_str(), &st) != 0, "the pass left the planted tree");

  std::printf("create latency of one client while %d files are removed\n", files);
  std::printf("%-40s %8s %13s %13s %8s\n", "", "creates", "p50", "p99", "p99 x");
  print("nothing else running", quiet, quiet);
  print("rm -rf at normal priority", rmRun, quiet);
  print("death-row pass (idle I/O, SCHED_IDLE)", passRun, quiet);
  std::printf("the pass took %.1f s\n", passSeconds);
  std::system(("rm -rf " + root).c_str());
  return 0;
}
