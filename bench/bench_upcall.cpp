// Upcall round trip for a program with 4 groups: quarterd against an
// in-process echo server with the same framing on the same socket type,
// which reads the request buffer and answers a reply of the same shape.
// Every process start waits on this path.
//
//   bench_upcall --daemon QUARTERD [--seconds N] [--clients 1,8]
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "QuarterKit/Upcall.h"
#include "QuarterKit/QuarterKit.h"
#include "QuarterKit/Requests.h"
#include "base/PlistCodec.h"
#include "base/PlistValue.h"
#include "base/QRTProtocol.h"
#include "bench/BenchLoad.h"
#include "packbuff/packbuff.h"
#include "platform/UpcallSocket.h"

namespace {

using bench::Clock;

using Stats = bench::LoadStats;

qk::UpcallRequest programWithGroups() {
  qk::UpcallRequest r;
  r.codeSignatureId = "com.example.bench";
  r.personaId = 501;
  r.containerType = 0;
  for (int i = 0; i < 4; ++i) r.appGroupIds.push_back("group.com.example.bench." + std::to_string(i));
  return r;
}

void kernelLoop(const std::string& path, Clock::time_point deadline, std::vector<uint32_t>& ns, uint64_t& unexpected) {
  auto kernel = qk::UpcallClient::connect(path);
  if (!kernel) {
    ++unexpected;
    return;
  }
  const qk::UpcallRequest request = programWithGroups();
  for (int i = 0; i < 20; ++i) kernel->call(request);  // the containers exist from here on
  ns.reserve(1 << 20);
  while (Clock::now() < deadline) {
    auto start = Clock::now();
    auto answer = kernel->call(request);
    ns.push_back(bench::nanosecondsSince(start));
    if (!answer || answer->returnCode != 0 || answer->status != 1u || answer->groups.size() != 4) {
      ++unexpected;
      if (!answer) return;
    }
  }
}

Stats measure(const std::string& path, int kernels, double seconds) {
  return bench::runLoad(kernels, seconds,
                        [&](Clock::time_point deadline, std::vector<uint32_t>& ns, uint64_t& unexpected) {
                          kernelLoop(path, deadline, ns, unexpected);
                        });
}

// The reply the daemon gives such a program, with made-up paths of the same length.
std::vector<uint8_t> echoReply() {
  sb_packbuff* pb = sb_packbuff_new(4096);
  const std::string dir =
      "/tmp/quarterd-bench-XXXXXX/private/var/mobile/Containers/Data/Application/"
      "00000000-0000-0000-0000-000000000000";
  sb_packbuff_pack_string(pb, 100, "/private/var/mobile", 19);
  sb_packbuff_pack_string(pb, 1, dir.c_str(), dir.size());
  sb_packbuff_pack_string(pb, 2, (dir + "/tmp").c_str(), dir.size() + 4);
  for (int i = 0; i < 4; ++i)
    sb_packbuff_pack_key_with_string_value(pb, 3, ("group.com.example.bench." + std::to_string(i)).c_str(), 4,
                                           dir.c_str());
  sb_packbuff_pack_uint32(pb, 0, 1);
  const uint8_t* b = static_cast<const uint8_t*>(sb_packbuff_get_bytes(pb));
  std::vector<uint8_t> out(b, b + sb_packbuff_get_size(pb));
  sb_packbuff_free(pb);
  return out;
}

class EchoServer {
 public:
  explicit EchoServer(const std::string& path) : path_(path), reply_(echoReply()) {
    listener_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    snprintf(address.sun_path, sizeof address.sun_path, "%s", path.c_str());
    ::unlink(path.c_str());
    if (::bind(listener_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 || ::listen(listener_, 64) != 0) {
      perror("bench_upcall: echo server");
      exit(2);
    }
    acceptor_ = std::thread([this] {
      for (;;) {
        int fd = ::accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
          if (errno == EINTR || errno == ECONNABORTED) continue;
          return;
        }
        connections_.emplace_back([this, fd] { serve(fd); });
      }
    });
  }
  ~EchoServer() {
    ::shutdown(listener_, SHUT_RDWR);
    acceptor_.join();
    for (auto& t : connections_) t.join();
    ::close(listener_);
    ::unlink(path_.c_str());
  }

 private:
  void serve(int fd) {
    std::vector<uint8_t> buffer;
    uint8_t chunk[64 * 1024];
    for (;;) {
      platform::UpcallMessage m;
      size_t consumed = 0;
      auto parsed = platform::parseUpcallFrame(buffer, &m, &consumed);
      if (parsed == platform::UpcallParse::TooLarge) break;
      if (parsed == platform::UpcallParse::NeedMore) {
        ssize_t n = ::recv(fd, chunk, sizeof chunk, 0);
        if (n <= 0) break;
        buffer.insert(buffer.end(), chunk, chunk + n);
        continue;
      }
      // Read the request through, as the server does.
      sb_packbuff* pb = sb_packbuff_init_with_buffer(const_cast<uint8_t*>(m.region.data()), m.region.size(), true, 0);
      uint16_t type = 0;
      int rc = 0;
      while (pb && rc == 0 && sb_packbuff_get_item_value_type(pb, &type)) {
        if (type == 3 || type == 5)
          sb_packbuff_unpack_uint32(pb, &rc);
        else
          sb_packbuff_unpack_string(pb, nullptr, &rc);
      }
      sb_packbuff_free(pb);
      std::vector<uint8_t> frame = platform::encodeUpcallReply({m.id + 100, 0, reply_});
      buffer.erase(buffer.begin(), buffer.begin() + static_cast<ptrdiff_t>(consumed));
      if (::send(fd, frame.data(), frame.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(frame.size())) break;
    }
    ::close(fd);
  }

  std::string path_;
  std::vector<uint8_t> reply_;
  int listener_ = -1;
  std::thread acceptor_;
  std::vector<std::thread> connections_;
};

// quarterd on a fresh device root, stopped and removed on destruction.
class Daemon {
 public:
  explicit Daemon(const std::string& binary) {
    char dir[] = "/tmp/quarterd-bench-XXXXXX";
    if (!mkdtemp(dir)) exit(2);
    root_ = dir;
    std::filesystem::create_directories(root_ / "etc");
    std::filesystem::create_directories(root_ / "private/var/mobile");
    std::ofstream(root_ / "etc/passwd") << "root:x:0:0::/private/var/root:/bin/sh\n"
                                           "_installer:x:33:33::/private/var/emplacerd:/bin/false\n"
                                           "_system:x:499:499::/private/var/empty:/bin/false\n"
                                           "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
    std::ofstream(root_ / "etc/group") << "wheel:x:0:root\n_installer:x:33:\nsystemusers:x:498:_installer,_system\n"
                                          "_system:x:499:\nmobile:x:501:\n";
    // This program registers the one it launches, as an installer would.
    const plist::Dictionary identity{{"Executable", std::filesystem::read_symlink("/proc/self/exe").string()},
                                     {"SigningIdentifier", std::string("com.norvane.bench-upcall")},
                                     {"Entitlements", plist::Dictionary{{QRTEntitlementAllowed, true}}}};
    std::filesystem::create_directories(root_ / "etc/quarterd/identities");
    const plist::Data bytes = plist::writeBinary(identity);
    std::ofstream(root_ / "etc/quarterd/identities/bench-upcall.plist")
        .write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
    pid_ = fork();
    if (pid_ == 0) {
      std::string rootArg = root_.string();
      execl(binary.c_str(), binary.c_str(), "--root", rootArg.c_str(), static_cast<char*>(nullptr));
      _exit(127);
    }
  }
  ~Daemon() {
    ::kill(pid_, SIGTERM);
    int status = 0;
    ::waitpid(pid_, &status, 0);
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
  }
  // Waits up to 20 s for the daemon to answer, then registers the program
  // as an installer would, so each upcall takes the path of a real launch.
  bool waitUntilServing() {
    std::unique_ptr<qk::Connection> installer;
    for (int i = 0; i < 200 && !(installer = qk::Connection::connect(qk::requestSocketPath(root_.string()))); ++i)
      usleep(100'000);
    const plist::Dictionary info{{"com.norvane.QuarterKit.Entitlements", plist::Dictionary{}}};
    const plist::Dictionary options{{"com.norvane.QuarterKit.DataContainerClass", 2}};
    if (!installer) return false;
    const qk::Result registered = qk::processCodeSigningInfo(*installer, programWithGroups().codeSignatureId,
                                                             plist::Value(info), plist::Value(options));
    if (!registered || !registered->ok()) {
      fprintf(stderr, "bench_upcall: the program's registration failed: error %s\n",
              registered ? std::to_string(registered->error()).c_str() : "no reply");
      return false;
    }
    for (int i = 0; i < 200; ++i) {
      if (auto k = qk::UpcallClient::connect(socketPath())) {
        if (auto a = k->call(programWithGroups()); a && a->status == 1u) return true;
      }
      usleep(100'000);
    }
    return false;
  }
  std::string socketPath() const { return qk::upcallSocketPath(root_.string()); }

 private:
  std::filesystem::path root_;
  pid_t pid_ = -1;
};

void printRow(const char* target, int kernels, const Stats& s) {
  printf("%-8s %7d %10.0f %10.1f %10.1f %10llu\n", target, kernels, s.perSecond, s.p50us, s.p99us,
         static_cast<unsigned long long>(s.unexpected));
}

[[noreturn]] void usage() {
  fprintf(stderr, "usage: bench_upcall --daemon QUARTERD [--seconds N] [--clients 1,8]\n");
  exit(2);
}

}  // namespace

int main(int argc, char** argv) {
  std::string binary;
  double seconds = 3;
  std::vector<int> kernels = {1, 8};
  for (int i = 1; i + 1 < argc; i += 2) {
    std::string a = argv[i], v = argv[i + 1];
    if (a == "--daemon") {
      binary = v;
    } else if (a == "--seconds") {
      seconds = std::max(0.1, atof(v.c_str()));
    } else if (a == "--clients") {
      kernels.clear();
      for (size_t pos = 0; pos < v.size();) {
        int n = atoi(v.c_str() + pos);
        if (n < 1 || n > 64) usage();
        kernels.push_back(n);
        size_t comma = v.find(',', pos);
        pos = comma == std::string::npos ? v.size() : comma + 1;
      }
    } else {
      usage();
    }
  }
  if (binary.empty() || argc % 2 == 0) usage();
  Daemon daemon(binary);
  if (!daemon.waitUntilServing()) {
    fprintf(stderr, "bench_upcall: quarterd did not answer upcalls\n");
    return 2;
  }
  char dir[] = "/tmp/bench-upcall-echo-XXXXXX";
  if (!mkdtemp(dir)) return 2;
  const std::string echoPath = std::string(dir) + "/echo.sock";
  printf("%-8s %7s %10s %10s %10s %10s\n", "target", "kernels", "calls/s", "p50 us", "p99 us", "unexpected");
  std::vector<std::pair<Stats, Stats>> rows;
  {
    EchoServer echo(echoPath);
    for (int n : kernels) {
      rows.push_back({measure(echoPath, n, seconds), {}});
      printRow("echo", n, rows.back().first);
    }
  }
  rmdir(dir);
  for (size_t i = 0; i < kernels.size(); ++i) {
    rows[i].second = measure(daemon.socketPath(), kernels[i], seconds);
    printRow("daemon", kernels[i], rows[i].second);
  }
  for (size_t i = 0; i < kernels.size(); ++i) {
    const auto& [echo, d] = rows[i];
    if (echo.p50us > 0)
      printf("daemon/echo, %d kernels: p50 %.2fx (target <= 2), p99 %.0f us (target < 1000)\n", kernels[i],
             d.p50us / echo.p50us, d.p99us);
  }
  return 0;
}
