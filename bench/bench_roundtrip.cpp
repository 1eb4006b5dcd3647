// Request round trip: the daemon's cheapest dispatch path (a request refused
// for its entitlement) against an in-process echo server doing the same codec
// work, for 1 and 8 concurrent clients.
//
//   bench_roundtrip [--socket PATH | --daemon QUARTERD] [--seconds N] [--clients 1,8]
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "QuarterKit/QuarterKit.h"
#include "QuarterKit/Requests.h"
#include "base/Frame.h"
#include "base/QRTProtocol.h"
#include "Daemon/QRTMetrics.h"
#include "bench/BenchLoad.h"
#include "platform/Log.h"

namespace {

using bench::Clock;
constexpr uint64_t kRefused = 55;

using Stats = bench::LoadStats;

// Command 1 from a caller without entitlements: refused before any handler.
plist::Dictionary refusedRequest() {
  return qk::Request(qk::Command::containersForUser).u64("UserID", 501).u64("ContainerClass", 2).message();
}

// One client: synchronous request/reply loop until the deadline.
void clientLoop(const std::string& socketPath, Clock::time_point deadline, std::vector<uint32_t>& latenciesNs,
                uint64_t& unexpected) {
  std::string error;
  auto connection = qk::Connection::connect(socketPath, &error);
  if (!connection) {
    fprintf(stderr, "bench_roundtrip: %s\n", error.c_str());
    ++unexpected;
    return;
  }
  const plist::Dictionary request = refusedRequest();
  latenciesNs.reserve(1 << 20);
  for (int i = 0; i < 50; ++i) connection->call(request);  // warm-up
  while (Clock::now() < deadline) {
    auto start = Clock::now();
    auto reply = connection->call(request, std::chrono::seconds(10));
    latenciesNs.push_back(bench::nanosecondsSince(start));
    if (!reply || qk::Reply(std::move(*reply)).error() != kRefused) {
      ++unexpected;
      if (connection->closed()) return;
    }
  }
}

Stats measure(const std::string& socketPath, int clients, double seconds) {
  return bench::runLoad(clients, seconds,
                        [&](Clock::time_point deadline, std::vector<uint32_t>& ns, uint64_t& unexpected) {
                          clientLoop(socketPath, deadline, ns, unexpected);
                        });
}

// ---- the echo server ----------------------------------------------------------

// Answers every request with {"ReplyError": 55} after decoding it, the least
// work the daemon does for one.
class EchoServer {
 public:
  explicit EchoServer(const std::string& path) : path_(path) {
    listener_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
    ::unlink(path.c_str());
    if (::bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 || ::listen(listener_, 64) != 0) {
      perror("bench_roundtrip: echo server");
      exit(2);
    }
    acceptor_ = std::thread([this] { acceptLoop(); });
  }
  ~EchoServer() {
    ::shutdown(listener_, SHUT_RDWR);
    acceptor_.join();
    for (auto& t : connections_) t.join();
    ::close(listener_);
    ::unlink(path_.c_str());
  }

 private:
  void acceptLoop() {
    for (;;) {
      int fd = ::accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
      if (fd < 0) {
        if (errno == EINTR || errno == ECONNABORTED) continue;
        return;
      }
      connections_.emplace_back([fd] { serve(fd); });
    }
  }

  static void serve(int fd) {
    const plist::Dictionary reply = {{QRTReplyKeyError, kRefused}};
    frame::Decoder decoder;
    std::vector<uint8_t> buffer(64 * 1024);
    for (;;) {
      ssize_t n = ::recv(fd, buffer.data(), buffer.size(), 0);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) break;
      decoder.append(buffer.data(), static_cast<size_t>(n));
      bool ok = true;
      while (auto f = decoder.next()) {
        if (!frame::decodeMessage(f->payload)) ok = false;
        std::vector<uint8_t> bytes = frame::encode(f->messageId, reply);
        if (!ok || !frame::sendAll(fd, bytes.data(), bytes.size())) break;
      }
      if (!ok || decoder.failed()) break;
    }
    ::close(fd);
  }

  std::string path_;
  int listener_ = -1;
  std::thread acceptor_;
  std::vector<std::thread> connections_;  // only the acceptor adds, joined after it
};

// ---- a daemon of our own ------------------------------------------------------

void writeFile(const std::filesystem::path& path, const std::string& text) {
  std::filesystem::create_directories(path.parent_path());
  std::ofstream(path) << text;
}

bool canConnect(const std::string& path) { return qk::Connection::connect(path) != nullptr; }

// quarterd on a fresh device root, stopped and removed on destruction.
class Daemon {
 public:
  explicit Daemon(const std::string& binary) {
    char dir[] = "/tmp/quarterd-bench-XXXXXX";
    if (!mkdtemp(dir)) {
      perror("bench_roundtrip: mkdtemp");
      exit(2);
    }
    root_ = dir;
    writeFile(root_ / "etc/passwd",
              "root:x:0:0::/private/var/root:/bin/sh\n"
              "_installer:x:33:33::/private/var/emplacerd:/bin/false\n"
              "_system:x:499:499::/private/var/empty:/bin/false\n"
              "mobile:x:501:501::/private/var/mobile:/bin/sh\n");
    writeFile(
        root_ / "etc/group",
        "wheel:x:0:root\n_installer:x:33:\nsystemusers:x:498:_installer,_system\n_system:x:499:\nmobile:x:501:\n");
    pid_ = fork();
    if (pid_ == 0) {
      std::string rootArg = root_.string();
      execl(binary.c_str(), binary.c_str(), "--root", rootArg.c_str(), static_cast<char*>(nullptr));
      perror("bench_roundtrip: exec quarterd");
      _exit(127);
    }
  }
  ~Daemon() {
    if (pid_ > 0) {
      ::kill(pid_, SIGTERM);
      int status = 0;
      for (int i = 0; i < 150 && ::waitpid(pid_, &status, WNOHANG) == 0; ++i) usleep(100'000);
      if (::waitpid(pid_, &status, WNOHANG) == 0) {
        ::kill(pid_, SIGKILL);
        ::waitpid(pid_, &status, 0);
      }
    }
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
  }

  // Waits up to 20 s for the request socket to accept connections.
  bool waitUntilServing() {
    for (int i = 0; i < 200; ++i) {
      int status = 0;
      if (::waitpid(pid_, &status, WNOHANG) == pid_) {
        pid_ = -1;
        return false;
      }
      if (canConnect(socketPath())) return true;
      usleep(100'000);
    }
    return false;
  }
  std::string socketPath() const { return qk::requestSocketPath(root_.string()); }

 private:
  std::filesystem::path root_;
  pid_t pid_ = -1;
};

// ---- main -----------------------------------------------------------------------

struct Options {
  std::string socketPath;
  std::string daemonBinary;
  double seconds = 3;
  std::vector<int> clients = {1, 8};
};

[[noreturn]] void usage() {
  fprintf(stderr, "usage: bench_roundtrip [--socket PATH | --daemon QUARTERD] [--seconds N] [--clients 1,8]\n");
  exit(2);
}

Options parseOptions(int argc, char** argv) {
  Options o;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    if (i + 1 == argc) usage();
    std::string v = argv[++i];
    if (a == "--socket")
      o.socketPath = v;
    else if (a == "--daemon")
      o.daemonBinary = v;
    else if (a == "--seconds")
      o.seconds = std::max(0.1, atof(v.c_str()));
    else if (a == "--clients") {
      o.clients.clear();
      for (size_t pos = 0; pos < v.size();) {
        int n = atoi(v.c_str() + pos);
        if (n < 1 || n > 256) usage();
        o.clients.push_back(n);
        size_t comma = v.find(',', pos);
        pos = comma == std::string::npos ? v.size() : comma + 1;
      }
    } else
      usage();
  }
  return o;
}

void printRow(const char* target, int clients, const Stats& s) {
  printf("%-8s %7d %12.0f %10.1f %10.1f %10llu\n", target, clients, s.perSecond, s.p50us, s.p99us,
         static_cast<unsigned long long>(s.unexpected));
}

}  // namespace

// What counting costs each served request, in CPU: the clock read at
// receipt, the slot, the one at the reply, the histogram and the debug line
// that the default level drops.
double countingNanosecondsPerRequest() {
  constexpr int kRounds = 1'000'000;
  // The daemon's log: a file, filtered at the default level.
  platform::logSetSink([](int, const std::string&, const std::string&) {});
  platform::logSetLevel(platform::kLogNotice);
  const std::optional<std::string> caller = "com.example.bench";
  timespec start{}, end{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &start);
  for (int i = 0; i < kRounds; ++i) {
    const QRTMetrics::Clock::time_point received = QRTMetrics::Clock::now();
    const size_t slot = QRTMetrics::slotForCommand(7);
    const uint64_t micros = QRTMetrics::microsSince(received);
    QRTMetrics::requests(slot).record(micros, false);
    QRTLogAs(platform::kLogDebug, "QRTProcessRelayEvent", "Served %s for uid %u pid %d (%@): %llu in %llu us",
             "infoValueForKey", 501u, 1, caller, 1ull, static_cast<unsigned long long>(micros));
  }
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &end);
  return ((end.tv_sec - start.tv_sec) * 1e9 + (end.tv_nsec - start.tv_nsec)) / kRounds;
}

int main(int argc, char** argv) {
  Options options = parseOptions(argc, argv);
  std::optional<Daemon> daemon;
  if (!options.daemonBinary.empty()) {
    daemon.emplace(options.daemonBinary);
    if (!daemon->waitUntilServing()) {
      fprintf(stderr, "bench_roundtrip: quarterd did not start serving\n");
      return 2;
    }
    options.socketPath = daemon->socketPath();
  }
  char dir[] = "/tmp/bench-echo-XXXXXX";
  if (!mkdtemp(dir)) return 2;
  const std::string echoPath = std::string(dir) + "/echo.sock";

  printf("%-8s %7s %12s %10s %10s %10s\n", "target", "clients", "requests/s", "p50 us", "p99 us", "unexpected");
  std::vector<std::pair<Stats, Stats>> rows;  // echo, daemon
  {
    EchoServer echo(echoPath);
    for (int n : options.clients) {
      rows.push_back({measure(echoPath, n, options.seconds), {}});
      printRow("echo", n, rows.back().first);
    }
  }
  rmdir(dir);
  if (options.socketPath.empty()) {
    printf("daemon: skipped (give --socket PATH or --daemon QUARTERD)\n");
    return 0;
  }
  for (size_t i = 0; i < options.clients.size(); ++i) {
    rows[i].second = measure(options.socketPath, options.clients[i], options.seconds);
    printRow("daemon", options.clients[i], rows[i].second);
  }
  for (size_t i = 0; i < options.clients.size(); ++i) {
    const auto& [echo, d] = rows[i];
    if (echo.perSecond > 0 && echo.p50us > 0)
      printf("daemon/echo, %d clients: throughput %.2f, p50 latency %.2f\n", options.clients[i],
             d.perSecond / echo.perSecond, d.p50us / echo.p50us);
  }
  printf("request counting, CPU per request: %.1f ns\n", countingNanosecondsPerRequest());
  return 0;
}
