// What a user can make the root daemon do to files it does not own: links
// planted where the daemon expects its own directories and files, hard links
// to foreign files, and paths swapped while requests run. The daemon may
// refuse any of these; it must never change anything outside the user's reach
// and must keep serving.
#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <thread>
#include <utility>

#include "../unit/TempDir.h"
#include "DaemonFixture.h"
#include "base/PlistCodec.h"

namespace {

constexpr uid_t kUser = 501, kOtherUser = 502;
constexpr auto kRequestTimeout = std::chrono::seconds(10);
constexpr auto kRaceLimit = std::chrono::seconds(5);

using Snapshot = std::map<std::string, std::string>;

void addItem(Snapshot& snapshot, const std::string& path, bool recursive) {
  const std::string state = itemState(path, false);  // link counts left out
  if (state.empty()) return;
  snapshot[path] = state;
  if (recursive && std::filesystem::is_directory(std::filesystem::symlink_status(path)))
    for (const std::string& name : listDirectory(path)) addItem(snapshot, path + "/" + name, true);
}

// The first few differences, one a line; empty when there are none.
std::string differences(const Snapshot& before, const Snapshot& after) {
  std::string text;
  int count = 0;
  auto note = [&](const std::string& line) { text += ++count <= 8 ? "\n  " + line : ""; };
  for (const auto& [path, item] : before) {
    auto now = after.find(path);
    if (now == after.end())
      note("removed " + path);
    else if (now->second != item)
      note("changed " + path + ": " + item + "  =>  " + now->second);
  }
  for (const auto& [path, item] : after)
    if (!before.count(path)) note("created " + path + ": " + item);
  return count > 8 ? text + "\n  ... and " + std::to_string(count - 8) + " more" : text;
}

// The first item of the tree owned by uid, or "".
std::string firstOwnedBy(const std::string& tree, uid_t uid) {
  std::error_code ec;
  for (auto it = std::filesystem::recursive_directory_iterator(tree, ec);
       it != std::filesystem::recursive_directory_iterator(); it.increment(ec)) {
    struct stat st;
    if (lstat(it->path().c_str(), &st) == 0 && st.st_uid == uid) return it->path();
  }
  return "";
}

volatile sig_atomic_t gStopRacing = 0;

// A child of the user's that repeats a step until stopped (SIGUSR1, acted on
// between rounds) or out of time. Forked while this process has no connection
// open, hence no other thread.
class Racer {
 public:
  Racer(uid_t uid, const std::function<void()>& step) {
    if ((pid_ = fork()) != 0) return;
    signal(SIGUSR1, [](int) { gStopRacing = 1; });
    becomeUser(uid);
    long rounds = 0;
    for (auto end = std::chrono::steady_clock::now() + kRaceLimit;
         !gStopRacing && std::chrono::steady_clock::now() < end; ++rounds)
      step();
    _exit(rounds > 0 ? 0 : 1);
  }
  ~Racer() { finish(); }
  // Stops the child once it has put everything back; whether it ran a round.
  bool finish() {
    if (pid_ < 0) return false;
    kill(pid_, SIGUSR1);
    return exitStatus(std::exchange(pid_, -1)) == 0;
  }

 private:
  pid_t pid_ = -1;
};

// Moves a user's item aside and leaves a symbolic link to target in its place.
bool swapForLink(const std::string& path, const std::string& target) {
  return (rename(path.c_str(), (path + ".away").c_str()) == 0 || errno == ENOENT) &&
         symlink(target.c_str(), path.c_str()) == 0;
}
// One round of a race: the item trades places with a link to target for a
// moment, atomically, so that the path never goes missing.
void flip(const std::string& path, const std::string& target) {
  const std::string link = path + ".link";
  symlink(target.c_str(), link.c_str());
  if (renameat2(AT_FDCWD, path.c_str(), AT_FDCWD, link.c_str(), RENAME_EXCHANGE) == 0) {
    usleep(1000);
    renameat2(AT_FDCWD, path.c_str(), AT_FDCWD, link.c_str(), RENAME_EXCHANGE);
  }
  usleep(300);
}

class AdversarialTest;
struct Case {
  const char* name;
  // As root: containers, and the arrangement (planted by the user through asUser).
  std::function<void(AdversarialTest&)> setup;
  std::function<void(AdversarialTest&)> requests;
  // Repeated by the user while the requests run, each round ending where it began.
  std::function<void(const AdversarialTest&)> race = nullptr;
};

class AdversarialTest : public DaemonFixture, public ::testing::WithParamInterface<Case> {
 public:
  using DaemonFixture::deadDirectory, DaemonFixture::make, DaemonFixture::restartDaemon, DaemonFixture::root,
      DaemonFixture::createOrLookup, DaemonFixture::setIdentity, DaemonFixture::logContains, DaemonFixture::stopDaemon,
      DaemonFixture::startDaemon, DaemonFixture::daemon, DaemonFixture::logText, DaemonFixture::mountHomeOnTmpfs,
      DaemonFixture::reboot;
  void SetUp() override {
    DaemonFixture::SetUp();
    if (HasFatalFailure()) return;
    // The attacker's targets outside the device root, on its file system
    // so that hard links to them are possible.
    outside = root + "-outside";
    ASSERT_EQ(system(("rm -rf " + outside).c_str()), 0);
    ASSERT_EQ(mkdir(outside.c_str(), 0755), 0);
    ASSERT_EQ(mkdir((outside + "/sub").c_str(), 0700), 0);
    for (auto [name, mode] : {std::pair{"/secret", 0600}, {"/public", 0644}, {"/suid", 04755}, {"/sub/deep", 0600}}) {
      writeFile(outside + name, std::string("marker ") + name);
      ASSERT_EQ(chmod((outside + name).c_str(), static_cast<mode_t>(mode)), 0) << name;
    }
    for (const char* name : {"", "/secret", "/sub"})
      ASSERT_EQ(setxattr((outside + name).c_str(), "user.marker", name, strlen(name), 0), 0) << name;

    ASSERT_EQ(chown(home().c_str(), kUser, kUser), 0);
    std::ofstream(root + "/etc/passwd", std::ios::app) << "other:x:502:502::/private/var/other:/bin/sh\n";
    ASSERT_EQ(mkdir(otherHome().c_str(), 0755), 0);
    ASSERT_EQ(chown(otherHome().c_str(), kOtherUser, kOtherUser), 0);

    setOwnIdentity("com.example.installer",
                   {{QRTEntitlementAllowed, true}, {QRTEntitlementWipeContainer, plist::Array{"com.example.addon"}}});
    app = make(kUser, "com.example.app", 2);
    addon = make(kUser, "com.example.addon", 4);
    other = make(kOtherUser, "com.example.other", 2);
    writeFile(other.path + "/Documents/mine", "the other user's");
  }

  void TearDown() override {
    // A daemon stuck on a request would not stop on SIGTERM.
    if (stuck_ && daemon > 0) killDaemon();
    if (!HasFailure()) system(("rm -rf " + outside).c_str());
    DaemonFixture::TearDown();
  }

  // One request, bounded in time; its code (or its silence) goes into the trace.
  std::optional<plist::Dictionary> traced(uint64_t command, const plist::Dictionary& keys = {}) {
    auto connection = qk::Connection::connect(qk::requestSocketPath(root));
    auto reply = connection ? connection->call(request(command, keys), kRequestTimeout) : std::nullopt;
    trace_ += " " + std::to_string(command) + ":" + (reply ? std::to_string(codeOf(reply)) : "no reply");
    if (!reply) stuck_ = true;
    return reply;
  }
  uint64_t send(uint64_t command, const plist::Dictionary& keys = {}) { return codeOf(traced(command, keys)); }
  void sends(std::initializer_list<std::pair<uint64_t, plist::Dictionary>> requests) {
    for (const auto& [command, keys] : requests) send(command, keys);
  }

  // Requests sent (each `repeat` times) on one connection by a process of
  // uid's with no entitlement; how many did not answer expected (the process is lastPid).
  int sendsAs(uid_t uid, uint64_t expected, const std::vector<std::pair<uint64_t, plist::Dictionary>>& requests,
              int repeat = 1) {
    if ((lastPid = fork()) == 0) {
      becomeUser(uid);
      auto connection = qk::Connection::connect(qk::requestSocketPath(root));
      int wrong = 0;
      for (const auto& [command, keys] : requests)
        for (int i = 0; i < repeat; ++i)
          wrong += !connection || codeOf(connection->call(request(command, keys), kRequestTimeout)) != expected;
      _exit(std::min(wrong, 250));
    }
    return exitStatus(lastPid);
  }
  // quarterctl raw run by the user as the registered entitled program with
  // a library of theirs preloaded (it writes to preloadOut), or (bindOver) as
  // their own program mounted over its path in namespaces of their own; the
  // exit status, 125 when the namespaces are refused.
  int runEntitledAs(uid_t uid, bool bindOver, const std::vector<std::string>& raw) {
    const std::string entitled = root + "/usr/bin/entitledctl";
    pid_t pid = fork();
    if (pid == 0) {
      if (!bindOver) {
        int out = open(preloadOut().c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
        if (out < 0 || dup2(out, 1) != 1) _exit(126);
        setenv("LD_PRELOAD", QRT_EXEC_PRELOAD_PATH, 1);
        // The library is not built with the sanitizer the program may carry.
        const char* asan = getenv("ASAN_OPTIONS");
        setenv("ASAN_OPTIONS", (std::string(asan ? asan : "") + ":verify_asan_link_order=0").c_str(), 1);
      }
      becomeUser(uid);
      if (bindOver) {
        auto map = [](const char* file, const std::string& text) { std::ofstream(file) << text; };
        if (unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) _exit(125);
        map("/proc/self/setgroups", "deny");
        map("/proc/self/uid_map", "0 " + std::to_string(uid) + " 1");
        map("/proc/self/gid_map", "0 " + std::to_string(uid) + " 1");
        if (mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
            mount(QRT_QUARTERCTL_PATH, entitled.c_str(), nullptr, MS_BIND, nullptr) != 0)
          _exit(125);
      }
      std::vector<const char*> argv{entitled.c_str(), "--root", root.c_str(), "raw"};
      for (const std::string& arg : raw) argv.push_back(arg.c_str());
      argv.push_back(nullptr);
      execv(argv[0], const_cast<char* const*>(argv.data()));
      _exit(127);
    }
    return exitStatus(pid);
  }

  std::string preloadOut() const { return root + "/preloaded"; }

  void plant(const std::function<bool()>& step) { ASSERT_EQ(asUser(kUser, step), 0) << "the user could not plant"; }

  static plist::Dictionary creation(const std::string& identifier, bool transient = false) {
    return with(byName(kUser, 2, identifier), {{QRTKeyCreateIfNecessary, true}, {QRTKeyTransient, transient}});
  }

  std::string home() const { return root + "/private/var/mobile"; }
  std::string otherHome() const { return root + "/private/var/other"; }
  std::string containers() const { return home() + "/Containers"; }
  std::string in(const Container& c, const std::string& sub) const { return c.path + "/" + sub; }

  // Everything outside the user's reach that a request could be steered at.
  Snapshot snapshot() const {
    Snapshot s;
    for (const std::string& tree : {outside, root + "/etc", otherHome()}) addItem(s, tree, true);
    const std::string var = root + "/private/var", lib = var + "/root/Library", caches = daemonCaches();
    for (const std::string& item :
         {root, root + "/private", var, var + "/root", lib, lib + "/Caches", caches, caches + "/Dead",
          caches + "/Staging", caches + "/Temp", lib + "/QuarterKit", lib + "/QuarterKit/Replace",
          lib + "/Logs/QuarterKit", var + "/emplacerd", root + "/run", root + "/run/sandbox/mappings"})
      addItem(s, item, false);
    return s;
  }

  std::string outside;
  pid_t lastPid = -1;
  // The user's application and addon containers, a replacement, and another user's container.
  Container app, addon, fresh, other;
  std::string trace_;
  bool stuck_ = false;
};

TEST_P(AdversarialTest, NothingOutsideTheUsersReachChanges) {
  const Case& c = GetParam();
  ASSERT_NO_FATAL_FAILURE(c.setup(*this));
  if (IsSkipped()) return;
  const Snapshot before = snapshot();
  std::optional<Racer> racer;
  if (c.race) racer.emplace(kUser, [&] { c.race(*this); });
  c.requests(*this);
  if (racer) { EXPECT_TRUE(racer->finish()) << "the race never ran"; }

  RecordProperty("replies", trace_);
  const std::string changed = differences(before, snapshot());
  EXPECT_TRUE(changed.empty()) << "outside the user's reach:" << changed << "\nreplies (command:code):" << trace_;
  // Nothing of the user's reaches the global classes or the daemon's logs.
  for (const std::string& tree : {root + "/private/var/containers", root + "/private/var/root/Library/Logs"}) {
    EXPECT_EQ(firstOwnedBy(tree, kUser), "") << "the user's item in " << tree << "; replies:" << trace_;
  }
  auto reply = traced(QRTCommandCreateOrLookupContainer, byName(other));
  EXPECT_EQ(codeOf(reply), 1u) << "the daemon no longer serves; replies (command:code):" << trace_;
  EXPECT_EQ(at(reply, QRTReplyKeyPath), plist::Value(other.path)) << "the other user's container moved";
}

void PrintTo(const Case& c, std::ostream* out) { *out << c.name; }

using T = AdversarialTest;
using Requests = std::function<void(T&)>;
using PathOf = std::function<std::string(const T&)>;
// The user's item at path swapped for a link to target, then the requests.
Case swapped(const char* name, PathOf path, PathOf target, Requests requests) {
  return {name, [=](T& t) { t.plant([&] { return swapForLink(path(t), target(t)); }); }, std::move(requests)};
}
PathOf appItem(const std::string& sub) {
  return [sub](const T& t) { return t.in(t.app, sub); };
}
std::string appPath(const T& t) { return t.app.path; }
std::string outsideDir(const T& t) { return t.outside; }
std::string otherContainer(const T& t) { return t.other.path; }
// Each command on the app container's selector.
Requests onApp(std::vector<uint64_t> commands) {
  return [=](T& t) {
    for (uint64_t c : commands) t.send(c, selector(t.app));
  };
}
// The app container staged, then a death-row pass.
void stageThenPass(T& t) {
  t.sends({{QRTCommandStageContainerForDelete, stageKeys(t.app)}, {QRTCommandDeleteContainersOnDeathRow, {}}});
}
// The command on a container by name, then a death-row pass.
Requests byNameThenPass(uint64_t command, Container T::*c = &T::app) {
  return [=](T& t) { t.sends({{command, byName(t.*c)}, {QRTCommandDeleteContainersOnDeathRow, {}}}); };
}
const plist::Dictionary kSet{{QRTKeyKey, "k"}, {QRTKeyValue, "v"}};
// As the user: a directory that passes for the container (it has a copy of
// its metadata file), with links to targets where its default directories belong.
bool plantDecoy(const T& t, const Container& c, const std::string& dir) {
  std::error_code error;
  std::filesystem::create_directories(dir, error);
  writeFile(dir + "/" + kMetadataFile, readFile(t.in(c, kMetadataFile)));
  return exists(dir + "/" + kMetadataFile) && symlink(t.outside.c_str(), (dir + "/Documents").c_str()) == 0 &&
         symlink(t.outside.c_str(), (dir + "/Library").c_str()) == 0 &&
         symlink((t.root + "/etc").c_str(), (dir + "/tmp").c_str()) == 0;
}

// Hard links in the container to root-owned files outside, made by root: the
// kernel's protected_hardlinks keeps users from linking files they do not
// own, but such links may predate it or come from a restored backup.
void hardLinks(T& t) {
  ASSERT_EQ(link((t.outside + "/secret").c_str(), t.in(t.app, "Documents/secret").c_str()), 0);
  ASSERT_EQ(link((t.outside + "/suid").c_str(), t.in(t.app, "Library/suid").c_str()), 0);
}
// As the user: a class directory of their own whose application class is a link outside, and the race that
// swaps it with the real one.
void plantFakeClassDirectory(T& t) {
  t.plant([&] {
    return mkdir((t.home() + "/fake").c_str(), 0755) == 0 &&
           symlink(t.outside.c_str(), (t.home() + "/fake/Application").c_str()) == 0;
  });
}
void swapClassDirectoryForFake(const T& t) { flip(t.containers() + "/Data", t.home() + "/fake"); }
void freshApp(T& t) { t.fresh = t.make(kUser, "com.example.app", 2, true); }
// A root copy of quarterctl with the master entitlement (root's alone), and a system container it could delete.
const std::vector<std::string> kDeleteSystemContainer{"Command=u64:10", "UserID=u64:499", "ContainerClass=u64:12",
                                                      "Identifier=str:com.example.sysd"};
void registerEntitledCopy(T& t) {
  t.fresh = t.make(499, "com.example.sysd", 12);
  const std::string copy = t.root + "/usr/bin/entitledctl";
  ASSERT_EQ(system(("mkdir -p " + parentOf(copy) + " && cp " QRT_QUARTERCTL_PATH " " + copy).c_str()), 0);
  t.setIdentity("entitledctl", copy, "com.example.entitledctl", {{QRTEntitlementAllowed, true}});
}

// As the user: a container directory (made with its parents) whose metadata
// file names the identifier and class, with info values.
bool plantContainer(const std::string& dir, const std::string& identifier, uint64_t cls, uint64_t persona,
                    const plist::Dictionary& info) {
  std::error_code error;
  std::filesystem::create_directories(dir + "/Library", error);
  writePlist(dir + "/" + kMetadataFile, {{"QRTMetadataIdentifier", identifier},
                                         {"QRTMetadataUUID", QRTUUID::random().UUIDString()},
                                         {"QRTMetadataContentClass", cls},
                                         {"QRTMetadataPersona", persona},
                                         {"QRTMetadataInfo", info}});
  writeFile(dir + "/Library/planted", "the user's");
  return exists(dir + "/Library/planted");
}
// The next start counts as the first after a boot.
void reboot(T& t) {
  if (t.daemon > 0) { ASSERT_EQ(t.stopDaemon(), 0); }
  t.reboot();
  t.startDaemon();
}
std::string newUUIDIn(const std::string& dir) { return dir + "/" + QRTUUID::random().UUIDString(); }

const Case kCases[] = {
    // The metadata file.
    swapped(
        "MetadataLinkToDevicePasswd_SetInfo", appItem(kMetadataFile), [](const T& t) { return t.root + "/etc/passwd"; },
        [](T& t) { t.send(QRTCommandSetInfoValue, with(selector(t.app), kSet)); }),
    {"MetadataHardLinkToOutsideFile_SetInfo",
     [](T& t) {
       ASSERT_EQ(unlink(t.in(t.app, kMetadataFile).c_str()), 0);
       ASSERT_EQ(link((t.outside + "/public").c_str(), t.in(t.app, kMetadataFile).c_str()), 0);
     },
     [](T& t) { t.send(QRTCommandSetInfoValue, with(selector(t.app), kSet)); }},
    {"MetadataLinkToOtherUsersMetadata_Restart_ReadAndSet",
     [](T& t) {
       t.plant([&] { return swapForLink(t.in(t.app, kMetadataFile), t.in(t.other, kMetadataFile)); });
       t.restartDaemon();
     },
     [](T& t) {
       for (const Container* c : {&t.app, &t.other})
         t.sends({{QRTCommandMetadataForContainer, with(selector(*c), {{QRTKeyInfoDictRequested, true}})},
                  {QRTCommandInfoValueForKey, with(selector(*c), {{QRTKeyKey, "k"}})}});
       t.send(QRTCommandSetInfoValue, with(selector(t.app), kSet));
     }},
    {"MetadataFifo_Restart_LookupAndRead",
     [](T& t) {
       t.plant([&] {
         const std::string metadata = t.in(t.app, kMetadataFile);
         return unlink(metadata.c_str()) == 0 && mkfifo(metadata.c_str(), 0644) == 0;
       });
       t.restartDaemon();
     },
     [](T& t) {
       t.sends({{QRTCommandCreateOrLookupContainer, byName(t.app)},
                {7, selector(t.app)},
                {6, with(selector(t.app), {{QRTKeyKey, "k"}})},
                {23, selector(t.app)}});
     }},
    // Default sub-directories: recreated and given to the user.
    swapped("DocumentsLinkToOutside_Recreate", appItem("Documents"), outsideDir,
            onApp({QRTCommandRecreateDefaultStructure})),
    swapped("LibraryLinkToOutside_RecreateMissing", appItem("Library"), outsideDir,
            onApp({QRTCommandRecreateContainerStructure})),
    swapped(
        "TmpLinkToDeviceEtc_Recreate", appItem("tmp"), [](const T& t) { return t.root + "/etc"; },
        onApp({QRTCommandRecreateDefaultStructure})),
    swapped(
        "DocumentsLinkToOtherUsersDocuments_RecreateMissing", appItem("Documents"),
        [](const T& t) { return t.in(t.other, "Documents"); }, onApp({QRTCommandRecreateContainerStructure})),
    {"TmpAndCachesHardLinkedToOutsideFiles_Recreate",
     [](T& t) {
       t.plant(
           [&] { return rmdir(t.in(t.app, "tmp").c_str()) == 0 && rmdir(t.in(t.app, "Library/Caches").c_str()) == 0; });
       ASSERT_EQ(link((t.outside + "/secret").c_str(), t.in(t.app, "tmp").c_str()), 0);
       ASSERT_EQ(link((t.outside + "/suid").c_str(), t.in(t.app, "Library/Caches").c_str()), 0);
     },
     onApp({QRTCommandRecreateDefaultStructure, QRTCommandRecreateContainerStructure})},
    // Where new containers are made.
    {"ClassDirectoryLinkToOutside_Create",
     [](T& t) {
       t.plant([&] {
         const std::string data = t.containers() + "/Data";
         return rename(data.c_str(), (data + ".away").c_str()) == 0 && mkdir(data.c_str(), 0755) == 0 &&
                symlink(t.outside.c_str(), (data + "/Application").c_str()) == 0;
       });
     },
     [](T& t) { t.send(QRTCommandCreateOrLookupContainer, T::creation("com.example.new")); }},
    swapped(
        "ContainersLinkToOutside_Create", [](const T& t) { return t.containers(); }, outsideDir,
        [](T& t) {
          t.sends({{QRTCommandCreateOrLookupContainer, T::creation("com.example.new")},
                   {0, with(T::creation("com.example.new"), {{QRTKeyContainerClass, 6}})}});
        }),
    swapped(
        "HomeLibraryLinkToOutside_CreateTransient", [](const T& t) { return t.home() + "/Library"; }, outsideDir,
        [](T& t) { t.send(QRTCommandCreateOrLookupContainer, T::creation("com.example.new", true)); }),
    swapped(
        "HomeLibraryLinkToDaemonLibrary_CreateTransient", [](const T& t) { return t.home() + "/Library"; },
        [](const T& t) { return t.root + "/private/var/root/Library"; },
        [](T& t) { t.send(QRTCommandCreateOrLookupContainer, T::creation("com.example.new", true)); }),
    // The container directory itself.
    swapped("ContainerLinkToOutside_StageAndPass", appPath, outsideDir, stageThenPass),
    swapped("ContainerLinkToOtherUsersContainer_DeleteAndPass", appPath, otherContainer,
            byNameThenPass(QRTCommandDeleteContainer)),
    swapped("ContainerLinkToOtherUsersContainer_RegenerateUUID", appPath, otherContainer,
            onApp({QRTCommandRegenerateDirectoryUUID, QRTCommandRecreateDefaultStructure})),
    swapped("ContainerLinkToOtherUsersContainer_DiskUsage", appPath, otherContainer, onApp({QRTCommandDiskUsage})),
    swapped("ContainerLinkToOtherUsersContainer_Wipe", appPath, otherContainer,
            byNameThenPass(QRTCommandDeleteDataContainerContent)),
    swapped(
        "AddonContainerLinkToOtherUsersContainer_WipeAddon", [](const T& t) { return t.addon.path; }, otherContainer,
        byNameThenPass(QRTCommandWipeAddonDataContainer, &T::addon)),
    {"OldContainerLinkToOtherUsersContainer_Replace",
     [](T& t) {
       freshApp(t);
       t.plant([&] { return swapForLink(t.app.path, t.other.path); });
     },
     [](T& t) {
       t.sends(
           {{QRTCommandReplaceContainer, replaceKeys(&t.app, t.fresh)}, {QRTCommandDeleteContainersOnDeathRow, {}}});
     }},
    {"NewContainerLinkToOtherUsersContainer_Replace",
     [](T& t) {
       freshApp(t);
       t.plant([&] { return swapForLink(t.fresh.path, t.other.path); });
     },
     [](T& t) {
       t.sends({{QRTCommandReplaceContainer, replaceKeys(&t.app, t.fresh)},
                {QRTCommandRecreateDefaultStructure, selector(t.app)},
                {QRTCommandDeleteContainersOnDeathRow, {}}});
     }},
    // Hard links to files outside, inside a container that is then worked on.
    {"HardLinksInContainer_DeleteAndPass", hardLinks, byNameThenPass(QRTCommandDeleteContainer)},
    {"HardLinksInContainer_WipeAndPass", hardLinks, byNameThenPass(QRTCommandDeleteDataContainerContent)},
    {"HardLinksInContainer_UsageRegenerateRecreate", hardLinks,
     onApp({QRTCommandDiskUsage, QRTCommandRegenerateDirectoryUUID, QRTCommandRecreateContainerStructure})},
    {"FifoInContainer_UsageAndDelete",
     [](T& t) { t.plant([&] { return mkfifo(t.in(t.app, "Documents/pipe").c_str(), 0644) == 0; }); },
     [](T& t) {
       t.sends({{QRTCommandDiskUsage, selector(t.app)},
                {QRTCommandDeleteContainer, byName(t.app)},
                {QRTCommandDeleteContainersOnDeathRow, {}}});
     }},
    // Swaps while requests run.
    // A link to a decoy that passes for the container (it has the metadata
    // file), with links to targets where the default directories belong.
    {"RaceContainerAndLinkToDecoy_RecreateSetInfoUsage",
     [](T& t) { t.plant([&] { return plantDecoy(t, t.app, t.home() + "/decoy"); }); },
     [](T& t) {
       for (int i = 0; i < 20; ++i) {
         onApp({QRTCommandRecreateDefaultStructure, QRTCommandRecreateContainerStructure, QRTCommandDiskUsage})(t);
         t.send(QRTCommandSetInfoValue, with(selector(t.app), {{QRTKeyKey, "k"}, {QRTKeyValue, i}}));
       }
     },
     [](const T& t) { flip(t.app.path, t.home() + "/decoy"); }},
    {"RaceLibraryAndLink_Recreate", [](T&) {},
     [](T& t) {
       for (int i = 0; i < 30; ++i) t.send(i % 2 ? 8 : 22, selector(t.app));
     },
     [](const T& t) {
       rmdir(t.in(t.app, "Library/Caches").c_str());
       flip(t.in(t.app, "Library"), t.outside);
     }},
    {"RaceStagedContainerAndLinks_DeathRowPass",
     [](T& t) {
       for (int i = 0; i < 40; ++i) {
         const std::string dir = t.in(t.app, "Documents/d" + std::to_string(i));
         ASSERT_EQ(mkdir(dir.c_str(), 0755), 0);
         for (int j = 0; j < 20; ++j) writeFile(dir + "/f" + std::to_string(j), "x");
       }
       ASSERT_EQ(system(("chown -R 501:501 " + t.in(t.app, "Documents")).c_str()), 0);
     },
     stageThenPass,
     // The staged container stays the user's, and reachable, inside the death-row directory.
     [](const T& t) {
       static int i = 0;
       flip(t.deadDirectory() + "/" + baseName(t.app.path) + "/Documents/d" + std::to_string(i++ % 40), t.outside);
     }},
    {"RaceClassDirectoryAndLink_Create", plantFakeClassDirectory,
     [](T& t) {
       for (int i = 0; i < 20; ++i)
         t.send(QRTCommandCreateOrLookupContainer, T::creation("com.example.race" + std::to_string(i)));
     },
     swapClassDirectoryForFake},
    // Reads and writes of a container's metadata resolve from the held class
    // directory while the class directory is swapped for one with a link.
    {"RaceClassDirectoryAndLink_InfoAndMetadataReadsAndSet", plantFakeClassDirectory,
     [](T& t) {
       for (int i = 0; i < 20; ++i) {
         t.send(QRTCommandInfoValueForKey, with(selector(t.app), {{QRTKeyKey, "k"}}));
         t.send(QRTCommandMetadataForContainer, selector(t.app));
         t.send(QRTCommandSetInfoValue, with(selector(t.app), kSet));
       }
     },
     swapClassDirectoryForFake},
    {"RaceContainersAndLinkToDecoys_WipeReplaceStageRegenerateDelete",
     [](T& t) {
       t.plant([&] {
         return plantDecoy(t, t.app, t.home() + "/decoys/Data/Application/" + baseName(t.app.path)) &&
                plantDecoy(t, t.addon, t.home() + "/decoys/Data/AddonPlugin/" + baseName(t.addon.path));
       });
     },
     [](T& t) {
       t.send(QRTCommandDeleteDataContainerContent, byName(t.app));
       // The race may have the transient container refused; the replace then is too.
       t.sends({{QRTCommandReplaceContainer,
                 replaceKeys(&t.app, t.createOrLookup(kUser, "com.example.app", 2, true, true))},
                {QRTCommandStageContainerForDelete, stageKeys(t.addon)}});
       // Last: a new directory name lives in one of the two trees only.
       onApp({QRTCommandRegenerateDirectoryUUID, QRTCommandRegenerateDirectoryUUID, QRTCommandRegenerateDirectoryUUID})(
           t);
       byNameThenPass(QRTCommandDeleteContainer)(t);
     },
     [](const T& t) { flip(t.containers(), t.home() + "/decoys"); }},
    // Borrowed identities, requests no entitlement covers, refusals to flush the log.
    {"EntitledProgramRunByTheUser_AsWithPreload_DeleteSystemContainer", registerEntitledCopy,
     [](T& t) {
       t.runEntitledAs(kUser, false, kDeleteSystemContainer);
       EXPECT_TRUE(exists(t.fresh.path)) << "the system container was deleted";
       EXPECT_NE(readFile(t.preloadOut()).find("preloaded into"), std::string::npos) << "the library did not run";
     }},
    {"NamespaceBindMountOverEntitledProgram_DeleteSystemContainer", registerEntitledCopy,
     [](T& t) {
       if (t.runEntitledAs(kUser, true, kDeleteSystemContainer) == 125)
         GTEST_SKIP() << "unprivileged user and mount namespaces are refused here";
       EXPECT_TRUE(exists(t.fresh.path)) << "the system container was deleted";
       EXPECT_TRUE(t.logContains("runs another file than")) << "the mounted file was taken for the program";
     }},
    {"LongIdentifiers_300Creations", [](T&) {},
     [](T& t) {
       EXPECT_EQ(
           t.sendsAs(kUser, 11, {{QRTCommandCreateOrLookupContainer, T::creation(std::string(1 << 20, 'a'))}}, 300), 0)
           << "not refused with 11";
       EXPECT_EQ(listDirectory(parentOf(t.app.path)).size(), 1u) << "containers left in the class directory";
     }},
    {"ServiceAccountActsForOthers_TransientAndRootsHome",
     [](T& t) { std::ofstream(t.root + "/etc/passwd", std::ios::app) << "svc:x:120:120::/:/bin/false\n", freshApp(t); },
     [](T& t) {
       EXPECT_EQ(t.sendsAs(120, 38,
                           {{QRTCommandCreateOrLookupContainer, T::creation("com.example.app", true)},
                            {0, with(T::creation("com.example.app"), {{QRTKeyUserID, 0}})}}),
                 0);
       EXPECT_TRUE(exists(t.fresh.path)) << "the user's transient container was sent to death row";
     }},
    {"GlobalClassesWithoutEntitlement_CreateAndTransient",
     [](T& t) {
       t.fresh = t.make(33, "com.example.bundle", 1, true);
       writeFile(t.fresh.path + "/payload", "the installer's");
     },
     [](T& t) {
       const plist::Dictionary create{{QRTKeyCreateIfNecessary, true}},
           transient{{QRTKeyCreateIfNecessary, true}, {QRTKeyTransient, true}};
       EXPECT_EQ(t.sendsAs(kUser, 55,
                           {{QRTCommandCreateOrLookupContainer, with(byName(33, 1, "com.example.bundle"), transient)},
                            {0, with(byName(33, 3, "com.victim.app"), create)},
                            {0, with(byName(499, 13, "systemgroup.com.victim"), create)}}),
                 0);
       EXPECT_EQ(readFile(t.fresh.path + "/payload"), "the installer's");
       EXPECT_NE(t.createOrLookup(33, "com.victim.app", 3, false).error, 1u) << "a bundle container was made";
       EXPECT_NE(t.createOrLookup(499, "systemgroup.com.victim", 13, false).error, 1u)
           << "a system group container was made";
     }},
    {"RefusalsFlushingTheLog_800In200ms", [](T&) {},
     [](T& t) {
       t.sendsAs(kUser, 55, {{QRTCommandDeleteContainer, byName(t.other)}});
       const std::string evidence = "from pid " + std::to_string(t.lastPid) + " ";
       // Entitlement refusals and a handler's own refusal (a system container not entitled).
       EXPECT_EQ(t.sendsAs(kUser, 55,
                           {{17, {{QRTKeyGroupIdentifier, "systemgroup.com.victim"}}},
                            {QRTCommandCreateOrLookupContainer, byName(499, 12, "com.example.sysd")}},
                           400),
                 0);
       std::this_thread::sleep_for(std::chrono::milliseconds(1500));
       const std::string log = t.root + "/private/var/root/Library/Logs/QuarterKit/quarterd.log";
       const std::string text = readFile(log + ".0") + readFile(log);
       EXPECT_NE(text.find(evidence), std::string::npos) << "the refusal is gone";
       EXPECT_NE(text.find("Left out refusal lines over 20 a second: uid 501 "), std::string::npos) << "no summary";
       size_t lines = 0;
       for (size_t at = 0; (at = text.find("not entitled for system container", at)) != std::string::npos; ++at)
         ++lines;
       EXPECT_LE(lines, 60u) << "a handler's refusals are not limited";
     }},
    // Trees of the user's taken into global places at start-up.
    {"PlantedBackup_Reboot",
     [](T& t) {
       ASSERT_EQ(chown((t.home() + "/Library").c_str(), kUser, kUser), 0);  // as a user's own home has it
       t.plant([&] {
         const std::string backup = t.home() + "/Library/Backup/SystemContainers/Data/com.example.sysd";
         std::error_code error;
         std::filesystem::create_directories(backup + "/Library", error);
         writeFile(backup + "/Library/tool", "the user's");
         return chmod((backup + "/Library/tool").c_str(), 04755) == 0;
       });
       reboot(t);
     },
     [](T& t) { t.send(QRTCommandDeleteContainersOnDeathRow); }},
    {"PlantedBundleAndLogs_BuildUpgrade",
     [](T& t) {
       ASSERT_EQ(t.stopDaemon(), 0);
       // As before the daemon's first start on an older system: no bundle directory yet.
       ASSERT_EQ(system(("rm -rf " + t.root + "/private/var/containers/Bundle").c_str()), 0);
       ASSERT_EQ(chown((t.home() + "/Library").c_str(), kUser, kUser), 0);
       t.plant([&] {
         std::error_code error;
         std::filesystem::create_directories(t.home() + "/Library/Logs/QuarterKit", error);
         writeFile(t.home() + "/Library/Logs/QuarterKit/quarterd.log.0", "the user's");
         return plantContainer(newUUIDIn(t.containers() + "/Bundle/Application"), "com.victim.app", 1, 33, {});
       });
       writePlist(t.root + "/etc/system-version.plist", {{"BuildVersion", "99Z999"}});
       reboot(t);
     },
     [](T& t) { EXPECT_EQ(t.send(QRTCommandCreateOrLookupContainer, byName(33, 1, "com.victim.app")), 21u); }},
    {"PlantedMetadataWithGroupIds_DataMigration",
     [](T& t) {
       t.plant([&] {
         return plantContainer(newUUIDIn(t.containers() + "/Data/Application"), "com.victim.sysd", 2, kUser,
                               {{"com.norvane.Emplacer.GroupContainerIDs", plist::Array{"systemgroup.com.victim"}}});
       });
       t.restartDaemon();
     },
     [](T& t) {
       t.send(QRTCommandPerformDataMigration);
       EXPECT_EQ(t.logText().find("Migrating app group entitlements for com.victim.sysd"), std::string::npos);
     }},
    // Metadata that expands far past what a request could write (one string, shared 88 times).
    {"PlantedLargeMetadata_Lookup",
     [](T& t) {
       t.plant([&] {
         plist::Dictionary info;
         const std::string big(512 << 10, 'x');
         for (int i = 0; i < 88; ++i) info["k" + std::to_string(i)] = big;
         return plantContainer(newUUIDIn(t.containers() + "/Data/Application"), "com.example.big", 2, kUser, info);
       });
       t.restartDaemon();
     },
     [](T& t) { EXPECT_EQ(t.send(QRTCommandCreateOrLookupContainer, byName(kUser, 2, "com.example.big")), 21u); }},
    // Bounds on what one user holds.
    {"MassCreation_BoundPerClass", [](T& t) { writeFile(t.root + "/run/quarterd.maxcontainers", "3"); },
     [](T& t) {
       // Beside the application container made at set-up.
       for (int i = 0; i < 3; ++i)
         EXPECT_EQ(t.send(QRTCommandCreateOrLookupContainer, T::creation("com.example.mass" + std::to_string(i))),
                   i < 2 ? 1u : 38u);
       EXPECT_EQ(listDirectory(t.containers() + "/Data/Application").size(), 3u) << t.trace_;
     }},
    // A home on another file system: nothing is copied to the daemon's death row.
    {"DeletionAcrossFileSystems_HardLinksAndSparseFile",
     [](T& t) {
       if (!t.mountHomeOnTmpfs()) GTEST_SKIP() << "cannot mount a tmpfs for the home";
       t.plant([&] {
         const std::string file = t.in(t.app, "Documents/data");
         writeFile(file, std::string(1 << 20, 'd'));
         for (int i = 0; i < 50; ++i) link(file.c_str(), (file + std::to_string(i)).c_str());
         return close(open(t.in(t.app, "Documents/sparse").c_str(), O_CREAT | O_WRONLY, 0644)) == 0 &&
                truncate(t.in(t.app, "Documents/sparse").c_str(), 64 << 20) == 0;
       });
     },
     [](T& t) {
       t.send(QRTCommandDeleteContainer, byName(t.app));
       EXPECT_FALSE(exists(t.app.path)) << t.trace_;
       EXPECT_EQ(firstOwnedBy(t.deadDirectory(), kUser), "") << "copied to the daemon's death row";
     }},
};

INSTANTIATE_TEST_SUITE_P(Arrangements, AdversarialTest, ::testing::ValuesIn(kCases),
                         [](const ::testing::TestParamInfo<Case>& info) { return std::string(info.param.name); });

}  // namespace
