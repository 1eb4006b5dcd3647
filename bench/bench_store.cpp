// The container store's two costly paths against floors that make the same
// system calls without the daemon around them:
//  - creating a container (staging mkdir, atomic metadata write with fsync and
//    rename, five sub-directories, rename into place and both directories
//    flushed), per creation;
//  - the first look-up in a class directory of N containers (the cache build)
//    against reading and parsing the same N metadata files;
//  - a verify of the whole store once those N are cached, against that
//    cache build (the target is at most twice as long).
// Usage: bench_store [creations (default 300)] [containers (default 10000)] [scratch-parent]
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <vector>

#include "base/PlistCodec.h"
#include "base/QRTUUID.h"
#include "Daemon/store/QRTClientConnection.h"
#include "Daemon/store/QRTContainerCache.h"
#include "Daemon/store/QRTGlobalConfiguration.h"
#include "Daemon/verify/QRTVerify.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"

namespace {

using Clock = std::chrono::steady_clock;

double since(Clock::time_point start) { return std::chrono::duration<double>(Clock::now() - start).count(); }

[[noreturn]] void fail(const std::string& what) {
  std::fprintf(stderr, "failed: %s\n", what.c_str());
  std::exit(1);
}

void check(bool ok, const std::string& what) {
  if (!ok) fail(what);
}

// The creation floor: the same calls the daemon makes for one data container.
void floorCreate(const std::string& staging, const std::string& classDir, const plist::Data& metadata) {
  const std::string name = QRTUUID::random().UUIDString();
  const std::string dir = staging + "/" + name;
  check(mkdir(dir.c_str(), 0755) == 0, "mkdir " + dir);
  const std::string tmp = dir + "/.metadata.tmp", file = dir + "/.com.norvane.quarter_kit.metadata.plist";
  int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
  check(fd >= 0 && write(fd, metadata.data(), metadata.size()) == static_cast<ssize_t>(metadata.size()), tmp);
  check(fsync(fd) == 0, "fsync");
  close(fd);
  check(rename(tmp.c_str(), file.c_str()) == 0, "rename");
  int dirFd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  check(dirFd >= 0 && fsync(dirFd) == 0, "fsync dir");
  close(dirFd);
  for (const char* sub : {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"}) {
    check(mkdir((dir + "/" + sub).c_str(), 0755) == 0, sub);
  }
  check(rename(dir.c_str(), (classDir + "/" + name).c_str()) == 0, "rename into place");
  // The move into place is made durable before anyone hears of the container.
  for (const std::string& parent : {staging, classDir}) {
    int parentFd = open(parent.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    check(parentFd >= 0 && fsync(parentFd) == 0, "fsync " + parent);
    close(parentFd);
  }
}

// The cache-build floor: read and parse every metadata file of the class directory.
size_t floorReadAll(const std::string& classDir) {
  size_t parsed = 0;
  DIR* dir = opendir(classDir.c_str());
  check(dir != nullptr, classDir);
  while (dirent* entry = readdir(dir)) {
    if (entry->d_name[0] == '.') continue;
    std::ifstream in(classDir + "/" + entry->d_name + "/.com.norvane.quarter_kit.metadata.plist", std::ios::binary);
    std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    if (plist::parse(bytes.data(), bytes.size())) ++parsed;
  }
  closedir(dir);
  return parsed;
}

std::vector<std::string> names(const std::string& directory) {
  std::vector<std::string> out;
  DIR* dir = opendir(directory.c_str());
  check(dir != nullptr, directory);
  while (dirent* entry = readdir(dir))
    if (entry->d_name[0] != '.') out.emplace_back(entry->d_name);
  closedir(dir);
  return out;
}

std::string makeRoot(const std::string& parent) {
  std::string tmpl = parent + "/qrt-bench-store.XXXXXX";
  check(mkdtemp(tmpl.data()) != nullptr, "mkdtemp");
  check(system(("mkdir -p " + tmpl + "/etc " + tmpl + "/private/var/mobile").c_str()) == 0, "root dirs");
  std::ofstream(tmpl + "/etc/passwd") << "root:x:0:0::/private/var/root:/bin/sh\n"
                                         "mobile:x:501:501::/private/var/mobile:/bin/sh\n";
  return tmpl;
}

}  // namespace

int main(int argc, char** argv) {
  const int creations = argc > 1 ? std::atoi(argv[1]) : 300;
  const int containers = argc > 2 ? std::atoi(argv[2]) : 10000;
  const std::string root = makeRoot(argc > 3 ? argv[3] : "/var/tmp");
  platform::setDeviceRoot(root);
  platform::logOpen("/dev/null", "bench", platform::kLogNotice);

  QRTGlobalConfiguration& configuration = QRTGlobalConfiguration::sharedInstance();
  QRTClientConnection& client = QRTClientConnection::sharedClientConnection();
  const std::string staging = configuration.stagingDirectory().path();
  const std::string floorDir = root + "/floor";
  check(mkdir(floorDir.c_str(), 0755) == 0, floorDir);
  const plist::Data metadata = plist::writeBinary(plist::Dictionary{{"QRTMetadataIdentifier", "com.example.floor"},
                                                                    {"QRTMetadataUUID", QRTUUID::random().UUIDString()},
                                                                    {"QRTMetadataContentClass", 2},
                                                                    {"QRTMetadataPersona", 501}});

  // Alternate the two so that disk state changes hit both alike.
  double daemonSeconds = 0, floorSeconds = 0;
  for (int i = 0; i < creations; ++i) {
    auto start = Clock::now();
    uint64_t code = 1;
    check(
        client.createOrLookupContainerForUser({501, 2, "com.example.app" + std::to_string(i)},
                                              QRTCreateMode::CreateIfMissing, QRTLocking::TakeLocks, &code) != nullptr,
        "create");
    daemonSeconds += since(start);
    start = Clock::now();
    floorCreate(staging, floorDir, metadata);
    floorSeconds += since(start);
  }
  std::printf("%-28s %12s %12s %8s\n", "path", "quarterd", "floor", "ratio");
  std::printf("%-28s %10.0f us %10.0f us %8.2f\n", "create (per container)", 1e6 * daemonSeconds / creations,
              1e6 * floorSeconds / creations, daemonSeconds / floorSeconds);

  // The cache build needs a user whose class map has never been built: 502.
  std::ofstream(root + "/etc/passwd", std::ios::app) << "other:x:502:502::/private/var/other:/bin/sh\n";
  check(mkdir((root + "/private/var/other").c_str(), 0755) == 0, "home 502");
  const std::string classDir = configuration.containerDirectoryURLForUser(502, 2, false)->path();
  for (int i = 0; i < containers; ++i)
    floorCreate(staging, classDir,
                plist::writeBinary(plist::Dictionary{{"QRTMetadataIdentifier", "com.example.c" + std::to_string(i)},
                                                     {"QRTMetadataUUID", QRTUUID::random().UUIDString()},
                                                     {"QRTMetadataContentClass", 2},
                                                     {"QRTMetadataPersona", 502}}));
  // Given to their user as the daemon makes them, or verify reports each.
  for (const std::string& name : names(classDir))
    check(chown((classDir + "/" + name).c_str(), 502, 502) == 0, "chown " + name);
  floorReadAll(classDir);  // both sides read from a warm page cache
  auto start = Clock::now();
  size_t parsed = floorReadAll(classDir);
  floorSeconds = since(start);
  start = Clock::now();
  QRTErrorRef error;
  auto found = QRTContainerCache::sharedInstance().containerForUser({502, 2, std::string("com.example.c0")}, &error);
  daemonSeconds = since(start);
  check(found && parsed == static_cast<size_t>(containers), "cache build");
  std::printf("%-28s %10.1f ms %10.1f ms %8.2f\n", ("first look-up, " + std::to_string(containers)).c_str(),
              1e3 * daemonSeconds, 1e3 * floorSeconds, daemonSeconds / floorSeconds);
  start = Clock::now();
  QRTVerifyReport report = QRTVerifyStore(false);
  const double verifySeconds = since(start);
  check(report.containers == static_cast<uint64_t>(containers + creations), "verify");
  std::printf("%-28s %10.1f ms %10.1f ms %8.2f  (%zu findings; against the cache build)\n",
              ("verify, " + std::to_string(report.containers)).c_str(), 1e3 * verifySeconds, 1e3 * daemonSeconds,
              verifySeconds / daemonSeconds, report.findings.size());
  std::system(("rm -rf " + root).c_str());
  return 0;
}
