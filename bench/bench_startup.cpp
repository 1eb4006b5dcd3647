// Start-up of the daemon over a full store, and the data migration.
// 1. 10,000 containers of mixed classes and 10,000 code-signing entries with
//    nothing to migrate: time from exec to the first served request (command
//    1 over the largest class), after a restart and after a reboot, against
//    the cache build of the whole store alone (in a fresh process each round).
// 2. 10,000 data containers carrying group identifiers: command 24, per container.
// Usage: bench_startup [scratch-parent [--startup-only]] (default /var/tmp; not a tmpfs)
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "Daemon/codesign/QRTSQLiteDB.h"
#include "Daemon/store/QRTMigrationStatus.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/store/QRTMetadata.h"
#include "QuarterKit/QuarterKit.h"
#include "base/PlistCodec.h"
#include "base/QRTProtocol.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace {

using Clock = std::chrono::steady_clock;
constexpr int kRounds = 5;

struct Kind {
  uint32_t user;
  uint64_t cls;
  int count;
};
// 10,000 in all; the largest class first (the request that is timed lists it).
const Kind kStore[] = {{501, 2, 4000}, {33, 1, 3000}, {501, 4, 1000}, {33, 3, 1000}, {499, 12, 500}, {501, 7, 500}};

[[noreturn]] void fail(const std::string& what) {
  std::fprintf(stderr, "failed: %s\n", what.c_str());
  std::exit(1);
}

void put(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << text;
  if (!out.flush()) fail("write " + path);
}
void putPlist(const std::string& path, const plist::Dictionary& dictionary) {
  plist::Data bytes = plist::writeBinary(dictionary);
  put(path, std::string(bytes.begin(), bytes.end()));
}

std::string selfPath() {
  char path[4096];
  ssize_t n = readlink("/proc/self/exe", path, sizeof path - 1);
  if (n <= 0) fail("readlink /proc/self/exe");
  return std::string(path, static_cast<size_t>(n));
}

// Users, device files and an identity holding the master entitlement for this program.
void makeDeviceRoot(const std::string& root) {
  for (const char* dir : {"/etc/quarterd/identities", "/run/device", "/private/var/root", "/private/var/emplacerd",
                          "/private/var/mobile", "/private/var/empty"})
    if (std::system(("mkdir -p '" + root + dir + "'").c_str()) != 0) fail("mkdir " + root + dir);
  put(root + "/etc/passwd",
      "root:x:0:0::/private/var/root:/bin/sh\n_installer:x:33:33::/private/var/emplacerd:/bin/false\n"
      "_system:x:499:499::/private/var/empty:/bin/false\nmobile:x:501:501::/private/var/mobile:/bin/sh\n");
  put(root + "/etc/group", "wheel:x:0:\n_installer:x:33:\nsystemusers:x:499:\nmobile:x:501:\n");
  put(root + "/run/device/lockstate", "0\n");
  putPlist(root + "/etc/system-version.plist", {{"BuildVersion", "24A100"}, {"ReleaseType", "Internal"}});
  putPlist(root + "/etc/quarterd/identities/bench.plist",
           {{"Executable", selfPath()},
            {"SigningIdentifier", "com.norvane.bench"},
            {"Entitlements", plist::Dictionary{{"com.norvane.private.QuarterKit.allowed", true}}}});
}

// Containers written straight to disk: a directory and its metadata file.
void makeContainers(uint32_t user, uint64_t cls, int count, const std::function<plist::Dictionary(int)>& info) {
  auto dir = QRTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(user, cls, false);
  if (!dir) fail("class directory " + std::to_string(cls));
  for (int i = 0; i < count; ++i) {
    const QRTUUID uuid = QRTUUID::random();
    const std::string path = dir->path() + "/" + uuid.UUIDString();
    if (mkdir(path.c_str(), 0755) != 0) fail("mkdir " + path);
    plist::Dictionary metadata{
        {QRTMetadataIdentifierKey, "com.bench.c" + std::to_string(cls) + "." + std::to_string(i)},
        {QRTMetadataUUIDKey, uuid.UUIDString()},
        {QRTMetadataContentClassKey, plist::Value(cls)},
        {QRTMetadataPersonaKey, plist::Value(user)}};
    if (plist::Dictionary extra = info(i); !extra.empty()) metadata[QRTMetadataInfoKey] = std::move(extra);
    putPlist(path + "/" + QRTMetadataFileName, metadata);
  }
}

// Nothing left to migrate: the build recorded and every type done.
void recordEverything() {
  auto status = QRTMigrationStatus::init();
  if (!status) fail("migration status");
  status->writeCurrentBuildInfoToDisk();
  for (const char* type :
       {QRTMigrationTypeBundle, QRTMigrationTypeACL, QRTMigrationTypeGroupId, QRTMigrationTypeCodeSigning})
    status->setMigrationCompleteForType(type);
}

struct Daemon {
  pid_t pid = -1;
  void start(const std::string& quarterd, const std::string& root) {
    unlink(qk::requestSocketPath(root).c_str());
    pid = fork();
    if (pid == 0) {
      execl(quarterd.c_str(), quarterd.c_str(), "--root", root.c_str(), nullptr);
      _exit(127);
    }
  }
  void stop() {
    kill(pid, SIGTERM);
    int status = 0;
    waitpid(pid, &status, 0);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) fail("daemon exit status " + std::to_string(status));
  }
};

// One request, retried until the daemon listens; its "ReplyError".
uint64_t firstServed(const std::string& root, const plist::Dictionary& request) {
  const auto deadline = Clock::now() + std::chrono::seconds(120);
  while (Clock::now() < deadline) {
    if (auto connection = qk::Connection::connect(qk::requestSocketPath(root))) {
      auto reply = connection->call(request, std::chrono::seconds(600));
      const plist::Value* code = reply ? plist::find(*reply, QRTReplyKeyError) : nullptr;
      return code && code->isInteger() ? code->integer().asUnsigned() : 0;
    }
    std::this_thread::sleep_for(std::chrono::microseconds(200));
  }
  fail("daemon never answered");
}

double seconds(Clock::time_point since) { return std::chrono::duration<double>(Clock::now() - since).count(); }

double median(std::vector<double> v) {
  std::sort(v.begin(), v.end());
  return v[v.size() / 2];
}

// The cache of the classes given, built in a child so that each round starts empty.
double cacheBuild(const std::vector<Kind>& kinds) {
  int pipefd[2];
  if (pipe(pipefd) != 0) fail("pipe");
  pid_t child = fork();
  if (child == 0) {
    auto start = Clock::now();
    for (const Kind& kind : kinds) {
      auto list = QRTContainerCache::sharedInstance().allContainersForUser(kind.user, kind.cls, false, true, nullptr);
      if (!list || static_cast<int>(list->size()) != kind.count) _exit(1);
    }
    double elapsed = seconds(start);
    _exit(write(pipefd[1], &elapsed, sizeof elapsed) == sizeof elapsed ? 0 : 1);
  }
  close(pipefd[1]);
  double elapsed = 0;
  const bool got = read(pipefd[0], &elapsed, sizeof elapsed) == sizeof elapsed;
  close(pipefd[0]);
  int status = 0;
  waitpid(child, &status, 0);
  if (!got || !WIFEXITED(status) || WEXITSTATUS(status) != 0) fail("cache build");
  return elapsed;
}

}  // namespace

int main(int argc, char** argv) {
  const std::string parent = argc > 1 ? argv[1] : "/var/tmp";
  const std::string self = selfPath();
  const std::string quarterd = self.substr(0, self.rfind("/bench/")) + "/Daemon/quarterd";
  std::string scratch = parent + "/qrt-bench-startup.XXXXXX";
  if (!mkdtemp(scratch.data())) fail("mkdtemp in " + parent);
  chmod(scratch.c_str(), 0755);
  const std::string root = scratch + "/root";
  makeDeviceRoot(root);
  platform::setDeviceRoot(root);  // before the configuration computes any path
  platform::logOpen(scratch + "/bench.log", "bench_startup", platform::kLogError);

  // ---- 1. start-up with nothing to migrate ----
  for (const Kind& kind : kStore)
    makeContainers(kind.user, kind.cls, kind.count, [](int) { return plist::Dictionary{}; });
  {
    auto db = QRTSQLiteDB::initWithParentDirectoryURL(QRTGlobalConfiguration::sharedInstance().libraryDirectory());
    if (!db) fail("database");
    for (int i = 0; i < 10000; ++i) {
      QRTCodeSigningEntry entry(plist::Dictionary{{"com.norvane.QuarterKit.Entitlements",
                                                   plist::Dictionary{{"com.norvane.security.application-groups",
                                                                      plist::Array{"group.bench"}}}}},
                                2);
      if (!db->addCodeSigningEntry(&entry, "com.bench.cs." + std::to_string(i), nullptr)) fail("add entry");
    }
  }
  recordEverything();
  const plist::Dictionary list{{"Command", 1}, {"UserID", 501}, {"ContainerClass", 2}};
  Daemon daemon;
  daemon.start(quarterd, root);  // the first start after making the store: marker made, nothing else timed
  if (firstServed(root, list) != 1) fail("warm-up request");
  daemon.stop();

  std::vector<double> restart, reboot, cache, listed;
  for (int round = 0; round < kRounds; ++round) {
    for (bool rebooted : {false, true}) {
      if (rebooted) unlink((root + "/run/quarterd.fb_check").c_str());
      auto start = Clock::now();
      daemon.start(quarterd, root);
      if (firstServed(root, list) != 1) fail("list request");
      (rebooted ? reboot : restart).push_back(seconds(start));
      daemon.stop();
    }
    cache.push_back(cacheBuild({std::begin(kStore), std::end(kStore)}));
    listed.push_back(cacheBuild({kStore[0]}));
  }
  const double cacheMedian = median(listed);
  std::printf("10,000 containers (6 classes), 10,000 code-signing entries, median of %d rounds\n\n", kRounds);
  std::printf("%-44s %10s %8s\n", "", "seconds", "ratio");
  std::printf("%-44s %10.3f %8s\n", "cache build of the listed class (4,000)", cacheMedian, "1.00");
  std::printf("%-44s %10.3f %8.2f\n", "cache build of the whole store", median(cache), median(cache) / cacheMedian);
  std::printf("%-44s %10.3f %8.2f\n", "restart to first served request", median(restart),
              median(restart) / cacheMedian);
  std::printf("%-44s %10.3f %8.2f\n", "reboot to first served request", median(reboot), median(reboot) / cacheMedian);

  const bool startupOnly = argc > 2 && std::string(argv[2]) == "--startup-only";
  if (!startupOnly) {
    // ---- 2. data migration of 10,000 containers with group identifiers ----
    if (std::system(("rm -rf '" + root + "/private/var/mobile/Containers/Data/Application'").c_str()) != 0)
      fail("clear class 2");
    makeContainers(501, 2, 10000, [](int i) {
      return plist::Dictionary{
          {"com.norvane.Emplacer.GroupContainerIDs", plist::Array{"group.bench." + std::to_string(i % 50)}}};
    });
    {
      // The group migration not yet recorded.
      auto status = platform::readHostFile(root + "/private/var/root/Library/QuarterKit/qrt_migration_status.plist");
      auto value = status ? plist::parse(status->data(), status->size()) : std::nullopt;
      if (!value || !value->isDictionary()) fail("status file");
      plist::Dictionary dictionary = value->dictionary();
      dictionary.erase(QRTMigrationTypeGroupId);
      putPlist(root + "/private/var/root/Library/QuarterKit/qrt_migration_status.plist", dictionary);
    }
    daemon.start(quarterd, root);
    if (firstServed(root, {{"Command", 4}}) != 1) fail("death-row pass");
    auto start = Clock::now();
    if (firstServed(root, {{"Command", 24}}) != 1) fail("data migration");
    const double migration = seconds(start);
    daemon.stop();
    std::printf("\ndata migration, 10,000 containers with group identifiers (50 groups), one run\n");
    std::printf("%-44s %10.3f\n", "command 24, seconds", migration);
    std::printf("%-44s %10.1f\n", "per container, microseconds", migration / 10000 * 1e6);
  }

  platform::logClose();
  if (std::system(("rm -rf '" + scratch + "'").c_str()) != 0) fail("rm -rf " + scratch);
  return 0;
}
