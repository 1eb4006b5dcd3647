// quarter-bench: load generator for quarterd. Clients (one connection and
// thread each) run synchronous request loops of one container operation and
// the tool prints throughput and latency; --lookup-first instead times the
// first look-up after a restart, which builds the cache of a full class
// directory.
//
//   quarter-bench [--socket PATH | --daemon QUARTERD] [--seconds N] [--clients 1,8]
//   (neither --socket nor --daemon: the installed daemon at /run/quarterd/request.sock)
//                 [--op create|lookup|info-set|info-get|cs-set|cs-get|all] [--prefill N] [--lookup-first]
#include <limits.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <latch>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "QuarterKit/QuarterKit.h"
#include "QuarterKit/Requests.h"
#include "base/PlistCodec.h"
#include "base/QRTProtocol.h"
#include "base/QRTUUID.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr uint64_t kClass = 2;  // Data/Application
constexpr uint64_t kUser = 501;
constexpr int kLookupSetSize = 100;
constexpr int kWarmup = 20;
const char kPrefix[] = "com.norvane.bench.";

// Thrown rather than exiting, so that the daemon and its root are cleaned up.
struct BenchError : std::runtime_error {
  using std::runtime_error::runtime_error;
};

[[noreturn]] void die(const std::string& message) { throw BenchError(message); }

double secondsSince(Clock::time_point start) { return std::chrono::duration<double>(Clock::now() - start).count(); }

// ---- a daemon of our own ------------------------------------------------------

std::string ownExecutable() {
  char path[PATH_MAX];
  if (!realpath("/proc/self/exe", path)) die("cannot resolve /proc/self/exe");
  return path;
}

void writeFile(const std::filesystem::path& path, const std::string& bytes) {
  std::filesystem::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary) << bytes;
}

// quarterd on a fresh device root in which this program holds the master
// entitlement; stopped and removed on destruction. start() once made.
class BenchDaemon {
 public:
  explicit BenchDaemon(std::string binary) : binary_(std::move(binary)) {
    const std::string self = ownExecutable();
    char dir[] = "/tmp/quarter-bench-XXXXXX";
    if (!mkdtemp(dir)) die(std::string("mkdtemp: ") + strerror(errno));
    root_ = dir;
    writeFile(root_ / "etc/passwd",
              "root:x:0:0::/private/var/root:/bin/sh\n"
              "_installer:x:33:33::/private/var/emplacerd:/bin/false\n"
              "_system:x:499:499::/private/var/empty:/bin/false\n"
              "mobile:x:501:501::/private/var/mobile:/bin/sh\n");
    writeFile(root_ / "etc/group", "wheel:x:0:\n_installer:x:33:\nsystemusers:x:499:\nmobile:x:501:\n");
    plist::Dictionary identity{{"Executable", self},
                               {"SigningIdentifier", std::string("com.norvane.quarter-bench")},
                               {"Entitlements", plist::Dictionary{{QRTEntitlementAllowed, true}}}};
    plist::Data bytes = plist::writeBinary(identity);
    writeFile(root_ / "etc/quarterd/identities/quarter-bench.plist", std::string(bytes.begin(), bytes.end()));
  }
  ~BenchDaemon() {
    stop();
    std::error_code ignored;
    std::filesystem::remove_all(root_, ignored);
  }

  // SIGTERM, then a fresh process on the same root.
  void restart() {
    stop();
    start();
  }
  std::string socketPath() const { return qk::requestSocketPath(root_.string()); }

  void start() {
    ::unlink(socketPath().c_str());
    pid_ = fork();
    if (pid_ == 0) {
      std::string rootArg = root_.string();
      execl(binary_.c_str(), binary_.c_str(), "--root", rootArg.c_str(), static_cast<char*>(nullptr));
      perror("quarter-bench: exec quarterd");
      _exit(127);
    }
    if (pid_ < 0) die(std::string("fork: ") + strerror(errno));
    waitUntilServing();
  }

 private:
  void stop() {
    if (pid_ <= 0) return;
    ::kill(pid_, SIGTERM);
    int status = 0;
    for (int i = 0; i < 150 && ::waitpid(pid_, &status, WNOHANG) == 0; ++i) usleep(100'000);
    if (::waitpid(pid_, &status, WNOHANG) == 0) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, &status, 0);
    }
    pid_ = -1;
  }

  // Up to 20 s for the request socket to accept connections.
  void waitUntilServing() {
    for (int i = 0; i < 2000; ++i) {
      int status = 0;
      if (::waitpid(pid_, &status, WNOHANG) == pid_) {
        pid_ = -1;
        die("quarterd exited during start-up");
      }
      if (qk::Connection::connect(socketPath())) return;
      usleep(10'000);
    }
    die("quarterd did not start serving");
  }

  std::string binary_;
  std::filesystem::path root_;
  pid_t pid_ = -1;
};

// ---- operations -----------------------------------------------------------------

std::unique_ptr<qk::Connection> connectTo(const std::string& socketPath) {
  std::string error;
  auto connection = qk::Connection::connect(socketPath, &error);
  if (!connection) die(error);
  return connection;
}

bool succeeded(const qk::Result& reply) { return reply && reply->ok(); }

std::string lookupIdentifier(int i) { return kPrefix + std::string("lookup.") + std::to_string(i); }

// One client's connection and the container it works on.
struct Client {
  std::unique_ptr<qk::Connection> connection;
  int index = 0;
  uint64_t sequence = 0;
  std::string createPrefix;  // fresh per measurement, so every create creates
  qk::ContainerRef container{kUser, kClass, std::nullopt, std::nullopt};
};

// The per-client container of info-set and info-get, with a value to read.
bool prepareInfoContainer(Client& c) {
  std::string identifier = kPrefix + std::string("info.") + std::to_string(c.index);
  auto reply = qk::createOrLookupContainer(*c.connection, kUser, identifier, kClass, true, false);
  if (!succeeded(reply)) return false;
  c.container.identifier = identifier;
  c.container.uuid = reply->uuid(QRTReplyKeyUUID);
  return c.container.uuid && succeeded(qk::setInfoValue(*c.connection, c.container, "bench", plist::Value(0)));
}

// A program's code-signing registration, changed by every call of cs-set.
plist::Dictionary codeSigningInfo(uint64_t sequence) {
  plist::Dictionary entitlements{{"com.norvane.bench.sequence", plist::Value(plist::Integer{sequence, false})},
                                 {QRTEntitlementNone, true}};
  return {{"com.norvane.QuarterKit.Entitlements", entitlements}};
}

std::string codeSigningIdentifier(const Client& c) { return kPrefix + std::string("cs.") + std::to_string(c.index); }

bool registerCodeSigning(Client& c) {
  plist::Dictionary options{{"com.norvane.QuarterKit.DataContainerClass", 2}};
  return succeeded(qk::processCodeSigningInfo(*c.connection, codeSigningIdentifier(c),
                                              plist::Value(codeSigningInfo(c.sequence++)), plist::Value(options)));
}

struct Operation {
  const char* name;
  bool (*prepare)(Client&);
  bool (*issue)(Client&);  // one request; true when it succeeded
};

const Operation kOperations[] = {
    {"create", [](Client&) { return true; },
     [](Client& c) {
       std::string identifier = c.createPrefix + std::to_string(c.sequence++);
       return succeeded(qk::createOrLookupContainer(*c.connection, kUser, identifier, kClass, true, false));
     }},
    {"lookup", [](Client&) { return true; },
     [](Client& c) {
       std::string identifier = lookupIdentifier(static_cast<int>((c.index * 37 + c.sequence++) % kLookupSetSize));
       return succeeded(qk::createOrLookupContainer(*c.connection, kUser, identifier, kClass, false, false));
     }},
    {"info-set", prepareInfoContainer,
     [](Client& c) {
       plist::Value value(plist::Integer{c.sequence++, false});
       return succeeded(qk::setInfoValue(*c.connection, c.container, "bench", value));
     }},
    {"info-get", prepareInfoContainer,
     [](Client& c) { return succeeded(qk::infoValueForKey(*c.connection, c.container, "bench")); }},
    {"cs-set", registerCodeSigning, registerCodeSigning},
    {"cs-get", registerCodeSigning,
     [](Client& c) { return succeeded(qk::codeSigningInfoForIdentifier(*c.connection, codeSigningIdentifier(c))); }},
};

// ---- measuring ------------------------------------------------------------------

struct Stats {
  double opsPerSecond = 0;
  double p50us = 0;
  double p99us = 0;
  uint64_t requests = 0;
  uint64_t errors = 0;  // failed replies, no reply, or a client that could not prepare
};

struct ClientResult {
  std::vector<uint32_t> latenciesNs;
  uint64_t errors = 0;
};

// Prepares and warms up, reports ready, and loops from the common start
// until the deadline that the start signal carries.
void clientLoop(const Operation& op, Client& client, std::latch& ready, std::shared_future<Clock::time_point> go,
                ClientResult& out) {
  bool prepared = op.prepare(client);
  for (int i = 0; prepared && i < kWarmup; ++i) op.issue(client);
  out.latenciesNs.reserve(1 << 18);
  ready.count_down();
  const Clock::time_point deadline = go.get();
  if (!prepared) {
    ++out.errors;
    return;
  }
  while (Clock::now() < deadline) {
    auto start = Clock::now();
    bool ok = op.issue(client);
    auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now() - start).count();
    out.latenciesNs.push_back(static_cast<uint32_t>(std::min<int64_t>(ns, UINT32_MAX)));
    if (!ok) {
      ++out.errors;
      if (client.connection->closed()) return;
    }
  }
}

Stats summarize(std::vector<ClientResult>& results, double elapsed) {
  std::vector<uint32_t> all;
  Stats stats;
  for (ClientResult& r : results) {
    all.insert(all.end(), r.latenciesNs.begin(), r.latenciesNs.end());
    stats.errors += r.errors;
  }
  stats.requests = all.size();
  if (all.empty()) return stats;
  std::sort(all.begin(), all.end());
  stats.opsPerSecond = static_cast<double>(all.size()) / elapsed;
  stats.p50us = all[all.size() / 2] / 1000.0;
  stats.p99us = all[std::min(all.size() - 1, all.size() * 99 / 100)] / 1000.0;
  return stats;
}

Stats measure(const std::string& socketPath, const Operation& op, int clients, double seconds) {
  static int round = 0;
  ++round;
  std::vector<Client> state(clients);
  for (int i = 0; i < clients; ++i) {
    state[i].connection = connectTo(socketPath);
    state[i].index = i;
    state[i].createPrefix = kPrefix + std::string("create.r") + std::to_string(round) + ".c" + std::to_string(i) + ".";
  }
  std::vector<ClientResult> results(clients);
  std::latch ready(clients);
  std::promise<Clock::time_point> go;
  std::shared_future<Clock::time_point> deadline = go.get_future().share();
  std::vector<std::thread> threads;
  for (int i = 0; i < clients; ++i)
    threads.emplace_back(clientLoop, std::cref(op), std::ref(state[i]), std::ref(ready), deadline,
                         std::ref(results[i]));
  ready.wait();
  auto begin = Clock::now();
  go.set_value(begin + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds)));
  for (auto& t : threads) t.join();
  return summarize(results, secondsSince(begin));
}

// Creates identifiers [0, count) named by `name`, over several connections.
void createMany(const std::string& socketPath, int count, std::string (*name)(int)) {
  constexpr int kWorkers = 8;
  std::atomic<int> next{0}, failures{0};
  std::vector<std::unique_ptr<qk::Connection>> connections;
  for (int w = 0; w < kWorkers; ++w) connections.push_back(connectTo(socketPath));
  std::vector<std::thread> workers;
  for (auto& connection : connections) {
    workers.emplace_back([&, c = connection.get()] {
      for (int i = next++; i < count; i = next++)
        if (!succeeded(qk::createOrLookupContainer(*c, kUser, name(i), kClass, true, false))) ++failures;
    });
  }
  for (auto& t : workers) t.join();
  if (failures > 0) die(std::to_string(failures.load()) + " of " + std::to_string(count) + " creations failed");
}

std::string prefillIdentifier(int i) { return kPrefix + std::string("prefill.") + std::to_string(i); }

void prefill(const std::string& socketPath, int count) {
  if (count <= 0) return;
  auto start = Clock::now();
  createMany(socketPath, count, prefillIdentifier);
  double elapsed = secondsSince(start);
  printf("prefill: %d containers in %.1f s (%.0f creates/s, 8 connections)\n", count, elapsed, count / elapsed);
  fflush(stdout);
}

// ---- first look-up after a restart ---------------------------------------------

double timedLookupUs(qk::Connection& connection, const std::string& identifier) {
  auto start = Clock::now();
  auto reply = qk::createOrLookupContainer(connection, kUser, identifier, kClass, false, false);
  double us = secondsSince(start) * 1e6;
  if (!succeeded(reply)) die("look-up of " + identifier + " failed");
  return us;
}

void lookupFirst(BenchDaemon& daemon, int containers, int rounds) {
  prefill(daemon.socketPath(), containers);
  printf("%-6s %18s %18s %14s\n", "round", "first lookup ms", "second lookup us", "restart ms");
  for (int round = 1; round <= rounds; ++round) {
    auto restartStart = Clock::now();
    daemon.restart();
    double restartMs = secondsSince(restartStart) * 1e3;
    auto connection = connectTo(daemon.socketPath());
    // A request refused before any look-up (no UUID: error 11) pays the
    // entitlement check and the first code-signing registration, so the
    // timed look-up pays only for building the class's cache.
    qk::infoValueForKey(*connection, {kUser, kClass, prefillIdentifier(0), std::nullopt}, "bench");
    double first = timedLookupUs(*connection, prefillIdentifier(containers / 2));
    double second = timedLookupUs(*connection, prefillIdentifier(containers - 1));
    printf("%-6d %18.1f %18.1f %14.0f\n", round, first / 1e3, second, restartMs);
    fflush(stdout);
  }
}

// ---- main -----------------------------------------------------------------------

struct Options {
  std::string socketPath;
  std::string daemonBinary;
  double seconds = 3;
  std::vector<int> clients = {1, 8};
  std::vector<const Operation*> operations;
  std::optional<int> prefill;
  bool lookupFirst = false;
};

const char kUsage[] =
    "usage: quarter-bench [--socket PATH | --daemon QUARTERD] [--seconds N] [--clients 1,8]\n"
    "                     [--op create|lookup|info-set|info-get|cs-set|cs-get|all] [--prefill N] [--lookup-first]\n"
    "  --daemon QUARTERD  run QUARTERD on a temporary device root in which this program holds\n"
    "                     the master entitlement (with --socket, register it yourself)\n"
    "  --seconds N        seconds per operation and client count (default 3)\n"
    "  --clients LIST     client counts, one connection and thread each (default 1,8)\n"
    "  --op OP            the operation to load (default all); every container request is class 2,\n"
    "                     user 501; cs-set registers (command 18) and cs-get reads (command 19)\n"
    "                     one program's code-signing information per client\n"
    "  --prefill N        create N containers first\n"
    "  --lookup-first     with --daemon: prefill (default 10000), restart the daemon and time the\n"
    "                     first look-up, which builds the cache over the whole class directory\n";

[[noreturn]] void usage() {
  fputs(kUsage, stderr);
  exit(2);
}

std::vector<int> parseCounts(const std::string& text) {
  std::vector<int> counts;
  for (size_t pos = 0; pos < text.size();) {
    int n = atoi(text.c_str() + pos);
    if (n < 1 || n > 256) usage();
    counts.push_back(n);
    size_t comma = text.find(',', pos);
    pos = comma == std::string::npos ? text.size() : comma + 1;
  }
  if (counts.empty()) usage();
  return counts;
}

std::vector<const Operation*> parseOperation(const std::string& name) {
  std::vector<const Operation*> out;
  for (const Operation& op : kOperations)
    if (name == "all" || name == op.name) out.push_back(&op);
  if (out.empty()) usage();
  return out;
}

Options parseOptions(int argc, char** argv) {
  Options o;
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    if (a == "--lookup-first") {
      o.lookupFirst = true;
      continue;
    }
    if (i + 1 == argc) usage();
    std::string v = argv[++i];
    if (a == "--socket")
      o.socketPath = v;
    else if (a == "--daemon")
      o.daemonBinary = v;
    else if (a == "--seconds")
      o.seconds = std::max(0.1, atof(v.c_str()));
    else if (a == "--clients")
      o.clients = parseCounts(v);
    else if (a == "--op")
      o.operations = parseOperation(v);
    else if (a == "--prefill")
      o.prefill = std::max(0, atoi(v.c_str()));
    else
      usage();
  }
  if (!o.socketPath.empty() && !o.daemonBinary.empty()) usage();
  // Neither: this machine's daemon.
  if (o.socketPath.empty() && o.daemonBinary.empty()) o.socketPath = qk::requestSocketPath("");
  if (o.lookupFirst && o.daemonBinary.empty()) {
    fputs("quarter-bench: --lookup-first restarts the daemon: give --daemon\n", stderr);
    exit(2);
  }
  if (o.operations.empty()) o.operations = parseOperation("all");
  return o;
}

void runOperations(const Options& options) {
  prefill(options.socketPath, options.prefill.value_or(0));
  bool needsLookupSet = std::any_of(options.operations.begin(), options.operations.end(),
                                    [](const Operation* op) { return std::string(op->name) == "lookup"; });
  if (needsLookupSet) createMany(options.socketPath, kLookupSetSize, lookupIdentifier);
  printf("%-9s %7s %10s %10s %10s %10s %8s\n", "op", "clients", "ops/s", "p50 us", "p99 us", "requests", "errors");
  for (const Operation* op : options.operations) {
    for (int n : options.clients) {
      Stats s = measure(options.socketPath, *op, n, options.seconds);
      printf("%-9s %7d %10.0f %10.1f %10.1f %10llu %8llu\n", op->name, n, s.opsPerSecond, s.p50us, s.p99us,
             static_cast<unsigned long long>(s.requests), static_cast<unsigned long long>(s.errors));
      fflush(stdout);
    }
  }
}

// The machine may be shared; the load says how much to trust the numbers.
void printLoad() {
  std::ifstream in("/proc/loadavg");
  std::string one, five, fifteen;
  if (in >> one >> five >> fifteen)
    printf("load average: %s %s %s on %u CPUs\n", one.c_str(), five.c_str(), fifteen.c_str(),
           std::thread::hardware_concurrency());
}

}  // namespace

int main(int argc, char** argv) {
  Options options = parseOptions(argc, argv);
  printLoad();
  try {
    std::optional<BenchDaemon> daemon;
    if (!options.daemonBinary.empty()) {
      daemon.emplace(options.daemonBinary);
      daemon->start();
      options.socketPath = daemon->socketPath();
    }
    if (options.lookupFirst)
      lookupFirst(*daemon, std::max(1, options.prefill.value_or(10'000)), 3);
    else
      runOperations(options);
  } catch (const std::exception& e) {
    fprintf(stderr, "quarter-bench: %s\n", e.what());
    return 2;
  }
  return 0;
}
