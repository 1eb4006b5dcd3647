// Process start through quarter-exec (upcall, Landlock set-up, dropping to
// the user) against starting the same program directly: fork, exec, wait.
//
//   bench_exec --daemon QUARTERD --exec QUARTER_EXEC [--runs N] [--program PATH]
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "base/PlistCodec.h"

namespace {

using Clock = std::chrono::steady_clock;

double runOnce(const std::vector<std::string>& args) {
  std::vector<char*> argv;
  for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  auto start = Clock::now();
  pid_t child = fork();
  if (child == 0) {
    int null = open("/dev/null", O_WRONLY);
    if (null >= 0) dup2(null, STDOUT_FILENO);
    execv(argv[0], argv.data());
    _exit(127);
  }
  int status = 0;
  waitpid(child, &status, 0);
  double us = std::chrono::duration<double, std::micro>(Clock::now() - start).count();
  if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
    fprintf(stderr, "bench_exec: %s exited with %d\n", args.front().c_str(), status);
    exit(1);
  }
  return us;
}

struct Stats {
  double p50 = 0, p90 = 0;
};

Stats measure(const std::vector<std::string>& args, int runs) {
  std::vector<double> us;
  for (int i = 0; i < runs; ++i) us.push_back(runOnce(args));
  std::sort(us.begin(), us.end());
  return {us[us.size() / 2], us[us.size() * 9 / 10]};
}

}  // namespace

int main(int argc, char** argv) {
  std::string daemonPath, execPath, program = "/usr/bin/true";
  int runs = 300;
  for (int i = 1; i + 1 < argc; i += 2) {
    std::string flag = argv[i];
    if (flag == "--daemon")
      daemonPath = argv[i + 1];
    else if (flag == "--exec")
      execPath = argv[i + 1];
    else if (flag == "--runs")
      runs = std::max(10, atoi(argv[i + 1]));
    else if (flag == "--program")
      program = argv[i + 1];
  }
  if (daemonPath.empty() || execPath.empty()) {
    fprintf(stderr, "usage: bench_exec --daemon QUARTERD --exec QUARTER_EXEC [--runs N] [--program PATH]\n");
    return 2;
  }

  char dir[] = "/tmp/quarterd-bench-XXXXXX";
  if (!mkdtemp(dir)) return 2;
  const std::filesystem::path root = dir;
  chmod(dir, 0755);
  std::filesystem::create_directories(root / "etc/quarterd/identities");
  std::filesystem::create_directories(root / "private/var/mobile");
  std::filesystem::create_directories(root / "bin");
  std::ofstream(root / "etc/passwd") << "root:x:0:0::/private/var/root:/bin/sh\n"
                                        "_installer:x:33:33::/private/var/emplacerd:/bin/false\n"
                                        "_system:x:499:499::/private/var/empty:/bin/false\n"
                                        "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
  std::ofstream(root / "etc/group") << "wheel:x:0:\n_installer:x:33:\nsystemusers:x:499:\nmobile:x:501:\n";
  // The same program in both runs: a copy the registry knows.
  const std::string copy = (root / "bin/program").string();
  std::filesystem::copy_file(program, copy);
  plist::Data identity = plist::writeBinary(plist::Dictionary{
      {"Executable", copy},
      {"SigningIdentifier", "com.example.bench"},
      {"Entitlements", plist::Dictionary{{"com.norvane.security.application-groups",
                                          plist::Array{"group.com.example.bench.0", "group.com.example.bench.1"}}}}});
  std::ofstream(root / "etc/quarterd/identities/bench.plist", std::ios::binary)
      .write(reinterpret_cast<const char*>(identity.data()), static_cast<std::streamsize>(identity.size()));

  pid_t daemon = fork();
  if (daemon == 0) {
    execl(daemonPath.c_str(), daemonPath.c_str(), "--root", dir, static_cast<char*>(nullptr));
    _exit(127);
  }
  const auto upcall = root / "run/com.norvane.quarterd.upcall";
  for (int i = 0; i < 400 && !std::filesystem::exists(upcall); ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(25));

  const std::vector<std::string> direct{copy};
  const std::vector<std::string> confined{execPath, "--root", dir, "--user", "501", "--identifier", "com.example.bench",
                                          "--",     copy};
  for (int i = 0; i < 10; ++i) runOnce(confined);  // the containers exist from here on
  // The launcher's start alone (a second exec, which any launcher costs),
  // so that the upcall and Landlock share shows.
  Stats d = measure(direct, runs), l = measure({execPath, "--version"}, runs), c = measure(confined, runs);
  printf("%-34s p50 %8.1f us   p90 %8.1f us\n", ("direct " + program).c_str(), d.p50, d.p90);
  printf("%-34s p50 %8.1f us   p90 %8.1f us\n", "quarter-exec --version alone", l.p50, l.p90);
  printf("%-34s p50 %8.1f us   p90 %8.1f us\n", "through quarter-exec", c.p50, c.p90);
  printf(
      "added latency (p50): %.1f us (target < 2000 us), of which the launcher's own exec %.1f us and\n"
      "the identity look-up, upcall and Landlock set-up %.1f us\n",
      c.p50 - d.p50, l.p50, c.p50 - d.p50 - l.p50);

  kill(daemon, SIGTERM);
  waitpid(daemon, nullptr, 0);
  std::filesystem::remove_all(root);
  return 0;
}
