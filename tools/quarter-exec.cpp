// quarter-exec: the sandbox launcher. Asks quarterd's upcall socket for a
// program's containers, confines the program to them with Landlock, drops to
// the user and executes it.
#include <dirent.h>
#include <fcntl.h>
#include <getopt.h>
#include <grp.h>
#include <limits.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <set>
#include <utility>

#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <optional>
#include <string>
#include <vector>

#include "QuarterKit/Upcall.h"
#include "base/PlistCodec.h"
#include "platform/DeviceRoot.h"
#include "platform/HostProfile.h"
#include "platform/Identity.h"
#include "platform/SafePath.h"
#include "platform/UserDatabase.h"

namespace {

constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;
constexpr int kExitCannotExecute = 126;
constexpr int kExitNotFound = 127;

const char kUsage[] = R"(usage: quarter-exec [--root DIR] [--no-network] [--allow-unconfined]
                    --user UID --identifier ID -- PROGRAM [ARGS...]

Runs PROGRAM as user UID, confined with Landlock to the containers quarterd
gives the program ID: read and write beneath its data container (HOME, TMPDIR
and the XDG_*_HOME directories lie there), its application group, system and
system group containers; execution of PROGRAM and of the system's programs
(never of another registered program, nor of anything in a container); reading
the system's files and /proc; /dev/tty. It starts with a clean environment and
no descriptor but 0, 1 and 2. Must be run as root; UID may not be 0.

Options:
  --root DIR          the device root of the daemon to ask (default QUARTERD_ROOT,
                      else this machine's daemon at /run/quarterd)
  --user UID          the user to run as and whose containers to use
  --identifier ID     the program's signing identifier; PROGRAM must be registered
                      under it in DIR/etc/quarterd/identities
  --no-network        no TCP bind or connect (Landlock ABI 4 or later)
  --allow-unconfined  run even when the kernel cannot confine as asked
  -h, --help          print this text and exit
  -V, --version       print the version and exit
)";

// Landlock's user interface, declared here: the system headers may predate
// the rights and fields of the ABI the running kernel offers.
struct RulesetAttr {
  uint64_t handledAccessFs;
  uint64_t handledAccessNet;
  uint64_t scoped;
};
struct PathBeneathAttr {
  uint64_t allowedAccess;
  int32_t parentFd;
} __attribute__((packed));

constexpr uint32_t kCreateRulesetVersion = 1u << 0;
constexpr int kRulePathBeneath = 1;
enum : uint64_t {
  kExecute = 1ull << 0,
  kWriteFile = 1ull << 1,
  kReadFile = 1ull << 2,
  kReadDir = 1ull << 3,
  kRemoveDir = 1ull << 4,
  kRemoveFile = 1ull << 5,
  kMakeChar = 1ull << 6,
  kMakeDir = 1ull << 7,
  kMakeReg = 1ull << 8,
  kMakeSock = 1ull << 9,
  kMakeFifo = 1ull << 10,
  kMakeBlock = 1ull << 11,
  kMakeSym = 1ull << 12,
  kRefer = 1ull << 13,     // ABI 2
  kTruncate = 1ull << 14,  // ABI 3
  kIoctlDev = 1ull << 15,  // ABI 5
};
constexpr uint64_t kNetBindTcp = 1ull << 0;               // ABI 4
constexpr uint64_t kNetConnectTcp = 1ull << 1;            // ABI 4
constexpr uint64_t kScopeAbstractUnixSocket = 1ull << 0;  // ABI 6
constexpr uint64_t kScopeSignal = 1ull << 1;              // ABI 6
// Rights that apply to a file rather than to what lies beneath a directory.
constexpr uint64_t kFileRights = kExecute | kWriteFile | kReadFile | kTruncate | kIoctlDev;
// Containers: everything but execution (nothing written there runs) and
// device nodes.
constexpr uint64_t kContainerRights = kWriteFile | kReadFile | kReadDir | kRemoveDir | kRemoveFile | kMakeDir |
                                      kMakeReg | kMakeSock | kMakeFifo | kMakeSym | kRefer | kTruncate;
constexpr uint64_t kReadRights = kReadFile | kReadDir;
// A container's top directory: dotfiles may be made and written there, but
// nothing removed or replaced, so the daemon's metadata file stays.
constexpr uint64_t kContainerTopRights =
    kReadFile | kReadDir | kWriteFile | kTruncate | kMakeDir | kMakeReg | kMakeSym | kMakeFifo | kMakeSock;
// Where system programs may live; each of their files is allowed on its own.
constexpr const char* kProgramDirectories[] = {"/usr/local/sbin", "/usr/local/bin", "/usr/sbin", "/usr/bin",
                                               "/sbin",           "/bin",           "/usr/games"};
constexpr const char* kLibraryDirectories[] = {"/lib",     "/lib64",     "/lib32",     "/libx32",
                                               "/usr/lib", "/usr/lib64", "/usr/lib32", "/usr/libx32"};
constexpr const char* kMetadataFileName = ".com.norvane.quarter_kit.metadata.plist";

struct Options {
  std::string root;  // empty: the host profile
  std::optional<uint32_t> user;
  std::string identifier;
  std::vector<std::string> command;
  bool noNetwork = false;
  bool allowUnconfined = false;
  bool help = false;
  bool version = false;
};

int fail(int status, const std::string& message) {
  fprintf(stderr, "quarter-exec: %s\n", message.c_str());
  return status;
}

struct UsageError {
  std::string message;
};

Options parseOptions(int argc, char** argv) {
  enum { kRoot = 1000, kUser, kIdentifier, kNoNetwork, kAllowUnconfined };
  static const option kLong[] = {
      {"root", required_argument, nullptr, kRoot},
      {"user", required_argument, nullptr, kUser},
      {"identifier", required_argument, nullptr, kIdentifier},
      {"no-network", no_argument, nullptr, kNoNetwork},
      {"allow-unconfined", no_argument, nullptr, kAllowUnconfined},
      {"help", no_argument, nullptr, 'h'},
      {"version", no_argument, nullptr, 'V'},
      {nullptr, 0, nullptr, 0},
  };
  Options options;
  opterr = 0;
  for (int c; (c = getopt_long(argc, argv, "+:hV", kLong, nullptr)) != -1;) {
    switch (c) {
      case kRoot: options.root = optarg; break;
      case kUser: {
        char* end = nullptr;
        errno = 0;
        unsigned long uid = strtoul(optarg, &end, 10);
        if (errno || !*optarg || *end || optarg[0] == '-' || uid >= UINT32_MAX)
          throw UsageError{"--user takes a numeric user id, not '" + std::string(optarg) + "'"};
        if (uid == 0) throw UsageError{"--user 0: root cannot be confined (it keeps every capability)"};
        options.user = static_cast<uint32_t>(uid);
        break;
      }
      case kIdentifier: options.identifier = optarg; break;
      case kNoNetwork: options.noNetwork = true; break;
      case kAllowUnconfined: options.allowUnconfined = true; break;
      case 'h': options.help = true; break;
      case 'V': options.version = true; break;
      case ':': throw UsageError{std::string(argv[optind - 1]) + " needs a value"};
      default: throw UsageError{"unknown option " + std::string(argv[optind - 1])};
    }
  }
  options.command.assign(argv + optind, argv + argc);
  if (options.help || options.version) return options;
  if (!options.user) throw UsageError{"--user is required"};
  if (options.identifier.empty()) throw UsageError{"--identifier is required"};
  if (options.command.empty()) throw UsageError{"no program given"};
  return options;
}

// PROGRAM as execvp would find it, resolved to the path the identity
// registry knows it by.
std::optional<std::string> resolveProgram(const std::string& name) {
  std::vector<std::string> candidates;
  if (name.find('/') != std::string::npos) {
    candidates.push_back(name);
  } else {
    const char* path = getenv("PATH");
    std::string search = path && *path ? path : "/usr/local/bin:/usr/bin:/bin";
    for (size_t start = 0; start <= search.size();) {
      size_t colon = search.find(':', start);
      if (colon == std::string::npos) colon = search.size();
      std::string dir = search.substr(start, colon - start);
      candidates.push_back((dir.empty() ? "." : dir) + "/" + name);
      start = colon + 1;
    }
  }
  for (const std::string& candidate : candidates) {
    char resolved[PATH_MAX];
    struct stat st;
    if (realpath(candidate.c_str(), resolved) && stat(resolved, &st) == 0 && S_ISREG(st.st_mode) &&
        access(resolved, X_OK) == 0)
      return std::string(resolved);
  }
  return std::nullopt;
}

// An entitlement that is a string or an array of strings.
std::vector<std::string> stringsOf(const std::optional<plist::Dictionary>& entitlements, const char* key) {
  std::vector<std::string> out;
  const plist::Value* value = entitlements ? plist::find(*entitlements, key) : nullptr;
  if (!value) return out;
  if (const std::string* s = value->stringIf()) out.push_back(*s);
  if (const plist::Array* array = value->arrayIf())
    for (const plist::Value& e : *array)
      if (const std::string* s = e.stringIf()) out.push_back(*s);
  return out;
}

using FileId = std::pair<dev_t, ino_t>;

// The files the identity registry names, with the identifier each is
// registered under. Paths are looked at as the daemon looks at them, links
// followed: that is the file an exec of the path runs.
std::vector<std::pair<FileId, std::string>> registeredFiles() {
  std::vector<std::pair<FileId, std::string>> files;
  platform::UniqueFd dir;
  if (platform::safeOpen(platform::hostPath("/etc/quarterd/identities"), O_RDONLY | O_DIRECTORY, &dir)) return files;
  DIR* listing = fdopendir(dup(dir.get()));
  if (!listing) return files;
  while (dirent* entry = readdir(listing)) {
    std::string bytes;
    if (entry->d_name[0] == '.' || platform::readFileAt(dir.get(), entry->d_name, &bytes, 1u << 20)) continue;
    std::optional<plist::Value> value = plist::parse(bytes.data(), bytes.size());
    const plist::Dictionary* entryDict = value ? value->dictionaryIf() : nullptr;
    const plist::Value* executable = entryDict ? plist::find(*entryDict, "Executable") : nullptr;
    const plist::Value* identifier = entryDict ? plist::find(*entryDict, "SigningIdentifier") : nullptr;
    struct stat st;
    if (!executable || !executable->stringIf() || stat(executable->stringIf()->c_str(), &st) != 0) continue;
    const std::string* id = identifier ? identifier->stringIf() : nullptr;
    files.emplace_back(FileId{st.st_dev, st.st_ino}, id ? *id : std::string());
  }
  closedir(listing);
  return files;
}

// What a look at every entry of a program directory found (1,400 in
// /usr/bin): every file may run, with the files and the links that lead out
// of it. Kept for the next launches with the directory's stamp; a verdict
// whose stamp differs is taken afresh. A file's owner or mode changed in
// place, which only root can do here, shows at the directory's next change
// or after a reboot.
struct ProgramDirectory {
  platform::ChangeStamp stamp;
  std::set<FileId> files;
  std::vector<std::string> elsewhere;
};
using ProgramDirectories = std::map<std::string, ProgramDirectory>;

constexpr const char* kKeptDirectoriesFile = "/run/device/program-directories";
constexpr const char* kKeptDirectoriesHeader = "quarter-exec program directories 1\n";

// The kept verdicts; none when the file is missing, malformed or not root's
// own and closed to everyone else.
ProgramDirectories readKeptDirectories() {
  ProgramDirectories kept;
  platform::UniqueFd fd;
  struct stat st;
  std::string text;
  if (platform::safeOpen(platform::hostPath(kKeptDirectoriesFile), O_RDONLY, &fd) || fstat(fd.get(), &st) != 0 ||
      !S_ISREG(st.st_mode) || st.st_uid != 0 || (st.st_mode & 022) || platform::readOpened(fd.get(), &text, 8u << 20) ||
      text.compare(0, strlen(kKeptDirectoriesHeader), kKeptDirectoriesHeader) != 0)
    return kept;
  ProgramDirectory* current = nullptr;
  for (size_t at = strlen(kKeptDirectoriesHeader), end; at < text.size(); at = end + 1) {
    end = text.find('\n', at);
    if (end == std::string::npos) return {};
    const std::string line = text.substr(at, end - at);
    char path[PATH_MAX];
    unsigned long long device, inode;
    long long seconds, nanoseconds;
    if (sscanf(line.c_str(), "directory %llu %llu %lld %lld %4095s", &device, &inode, &seconds, &nanoseconds, path) ==
        5) {
      current = &kept[path];
      *current = {{static_cast<dev_t>(device), static_cast<ino_t>(inode), {seconds, nanoseconds}}, {}, {}};
    } else if (current && sscanf(line.c_str(), "file %llu %llu", &device, &inode) == 2) {
      current->files.insert({static_cast<dev_t>(device), static_cast<ino_t>(inode)});
    } else if (current && line.compare(0, 5, "link ") == 0) {
      current->elsewhere.push_back(line.substr(5));
    } else {
      return {};
    }
  }
  return kept;
}

void writeKeptDirectories(const ProgramDirectories& kept) {
  std::string text = kKeptDirectoriesHeader;
  for (const auto& [path, dir] : kept) {
    text += "directory " + std::to_string(dir.stamp.device) + " " + std::to_string(dir.stamp.inode) + " " +
            std::to_string(dir.stamp.changed.tv_sec) + " " + std::to_string(dir.stamp.changed.tv_nsec) + " " + path +
            "\n";
    for (const auto& [device, inode] : dir.files)
      text += "file " + std::to_string(device) + " " + std::to_string(inode) + "\n";
    for (const std::string& link : dir.elsewhere) text += "link " + link + "\n";
  }
  platform::SafeParent parent;
  if (platform::safeOpenParent(platform::hostPath(kKeptDirectoriesFile), &parent) == 0)
    platform::replaceFileAt(parent.fd.get(), parent.name, text.data(), text.size(), 0644);
}

class Ruleset {
 public:
  // abi 0: Landlock is absent and nothing is enforced.
  Ruleset(int abi, bool noNetwork) : abi_(abi) {
    if (abi_ <= 0) return;
    handled_ = (1ull << 13) - 1;
    if (abi_ >= 2) handled_ |= kRefer;
    if (abi_ >= 3) handled_ |= kTruncate;
    if (abi_ >= 5) handled_ |= kIoctlDev;
    RulesetAttr attr{handled_, 0, 0};
    size_t size = sizeof attr.handledAccessFs;
    if (abi_ >= 4 && noNetwork) {
      // Handled with no rule: every TCP bind and connect is refused.
      attr.handledAccessNet = kNetBindTcp | kNetConnectTcp;
      size = offsetof(RulesetAttr, scoped);
    }
    if (abi_ >= 6) {
      // Nor may the program signal, or reach the abstract sockets of,
      // processes outside its confinement.
      attr.scoped = kScopeAbstractUnixSocket | kScopeSignal;
      size = sizeof attr;
    }
    fd_ = static_cast<int>(syscall(SYS_landlock_create_ruleset, &attr, size, 0));
  }

  bool valid() const { return abi_ <= 0 || fd_ >= 0; }

  // Rights beneath the item fd names (or on the file itself); those the
  // ABI does not know are dropped.
  int allow(int fd, uint64_t rights, bool isDirectory) {
    if (abi_ <= 0) return 0;
    PathBeneathAttr rule{rights & handled_ & (isDirectory ? ~0ull : kFileRights), fd};
    if (!rule.allowedAccess) return 0;
    return syscall(SYS_landlock_add_rule, fd_, kRulePathBeneath, &rule, 0) == 0 ? 0 : errno;
  }

  // A system path that may be missing (/lib64 on some systems); links are
  // followed, as the program's loader would follow them.
  int allowSystemPath(const char* path, uint64_t rights) {
    int fd = open(path, O_PATH | O_CLOEXEC);
    if (fd < 0) return errno == ENOENT ? 0 : errno;
    struct stat st;
    int err = fstat(fd, &st) == 0 ? allow(fd, rights, S_ISDIR(st.st_mode)) : errno;
    close(fd);
    return err;
  }

  // Everything beneath a container's items; at its top, where the daemon's
  // metadata file lies, new items only.
  int allowContainer(const std::string& path) {
    if (abi_ <= 0) return 0;
    platform::UniqueFd dir;
    if (int err = platform::safeOpen(path, O_RDONLY | O_DIRECTORY, &dir)) return err;
    if (int err = allow(dir.get(), kContainerTopRights, true)) return err;
    DIR* listing = fdopendir(dup(dir.get()));
    if (!listing) return errno;
    int err = 0;
    while (dirent* entry = readdir(listing)) {
      std::string name = entry->d_name;
      if (name == "." || name == ".." || name == kMetadataFileName) continue;
      platform::Item item;
      err = platform::openItemAt(dir.get(), name.c_str(), &item);
      const mode_t mode = item.st.st_mode;
      if (!err && (S_ISDIR(mode) || S_ISREG(mode))) err = allow(item.fd.get(), kContainerRights, S_ISDIR(mode));
      if (err) break;
    }
    closedir(listing);
    return err;
  }

  // Execution of each root-owned program file in the directory that no one
  // else can write, but for the registered ones other than the program
  // itself: run by the confined program (with a library of its own
  // preloaded), they would lend it their identity. A directory whose every
  // file qualifies takes one rule, and one for each file a link names
  // elsewhere. Its verdict is kept (ProgramDirectory) once the directory's
  // stamp has settled before since, when the launch began.
  int allowPrograms(const char* path, const std::set<FileId>& excluded, std::set<FileId>* seen,
                    ProgramDirectories* kept, bool* keptChanged, const struct timespec& since) {
    struct stat dir;
    // /bin is /usr/bin on a merged /usr: one walk.
    if (abi_ <= 0 || stat(path, &dir) != 0 || !seen->insert({dir.st_dev, dir.st_ino}).second) return 0;
    auto program = [](const struct stat& st) {
      return S_ISREG(st.st_mode) && (st.st_mode & 0111) && st.st_uid == 0 && !(st.st_mode & 022);
    };
    auto allowed = [&](const struct stat& st) { return program(st) && !excluded.count({st.st_dev, st.st_ino}); };
    ProgramDirectory looked;
    const ProgramDirectory* whole = nullptr;
    if (dir.st_uid == 0 && !(dir.st_mode & 022)) {
      const platform::ChangeStamp stamp = platform::ChangeStamp::of(dir);
      auto found = kept->find(path);
      if (found != kept->end() && found->second.stamp == stamp) {
        whole = &found->second;
      } else {
        if (found != kept->end()) kept->erase(found), *keptChanged = true;
        looked = {stamp, {}, {}};
        if (onlyAllowedFiles(path, program, &looked.files, &looked.elsewhere)) whole = &looked;
        // A link name that holds a line break cannot be written down.
        if (whole && stamp.settledBefore(since) &&
            std::none_of(looked.elsewhere.begin(), looked.elsewhere.end(),
                         [](const std::string& n) { return n.find('\n') != std::string::npos; })) {
          (*kept)[path] = looked;
          *keptChanged = true;
        }
      }
    }
    if (whole &&
        std::none_of(excluded.begin(), excluded.end(), [&](const FileId& id) { return whole->files.count(id); })) {
      if (int err = allowSystemPath(path, kExecute | kReadFile)) return err;
      for (const std::string& link : whole->elsewhere) {
        const int fd = open((std::string(path) + "/" + link).c_str(), O_PATH | O_CLOEXEC);
        struct stat st;
        const int err = fd >= 0 && fstat(fd, &st) == 0 && allowed(st) ? allow(fd, kExecute | kReadFile, false) : 0;
        if (fd >= 0) close(fd);
        if (err) return err;
      }
      return 0;
    }
    return forEachFile(
        path, [](const char*) { return true; },
        [&](int fd, const struct stat& st) {
          if (!allowed(st) || !seen->insert({st.st_dev, st.st_ino}).second) return 0;
          return allow(fd, kExecute | kReadFile, false);
        });
  }

  // The dynamic loaders (ld-*.so*), which the kernel executes for a program.
  int allowLoaders(const char* path, std::set<FileId>* seen) {
    struct stat dir;
    // /lib is /usr/lib on a merged /usr: one walk.
    if (abi_ <= 0 || stat(path, &dir) != 0 || !seen->insert({dir.st_dev, dir.st_ino}).second) return 0;
    return forEachFile(
        path, [](const char* name) { return strncmp(name, "ld-", 3) == 0 && strstr(name, ".so"); },
        [&](int fd, const struct stat& st) {
          return S_ISREG(st.st_mode) && st.st_uid == 0 ? allow(fd, kExecute | kReadFile, false) : 0;
        });
  }

  int restrictSelf() { return abi_ <= 0 || syscall(SYS_landlock_restrict_self, fd_, 0) == 0 ? 0 : errno; }

 private:
  // Whether every entry of the directory is a link or a file that
  // allowed(st) accepts (no hidden names), with those files and the names of
  // the links that lead to none of them.
  template <typename Allowed>
  static bool onlyAllowedFiles(const char* path, Allowed allowed, std::set<FileId>* files,
                               std::vector<std::string>* elsewhere) {
    int dirFd = open(path, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dirFd < 0) return false;
    DIR* listing = fdopendir(dirFd);
    if (!listing) return close(dirFd), false;
    std::vector<std::string> links;
    bool only = true;
    while (dirent* entry = readdir(listing)) {
      const std::string name = entry->d_name;
      if (name == "." || name == "..") continue;
      struct stat st;
      if (name[0] == '.' || platform::statSystemPathAt(dirFd, name.c_str(), &st, false) != 0) {
        only = false;
      } else if (S_ISLNK(st.st_mode)) {
        links.push_back(name);
      } else if ((only = allowed(st))) {
        files->insert({st.st_dev, st.st_ino});
      }
      if (!only) break;
    }
    for (const std::string& name : links) {
      struct stat st;
      if (only && platform::statSystemPathAt(dirFd, name.c_str(), &st, true) == 0 &&
          !files->count({st.st_dev, st.st_ino}))
        elsewhere->push_back(name);
    }
    closedir(listing);
    return only;
  }

  // fn(fd, st) for each entry of a system directory whose name wanted(name)
  // accepts, links followed (root's own); a missing directory is nothing to do.
  template <typename Wanted, typename Fn>
  static int forEachFile(const char* path, Wanted wanted, Fn fn) {
    int dirFd = open(path, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dirFd < 0) return errno == ENOENT || errno == ENOTDIR ? 0 : errno;
    DIR* listing = fdopendir(dirFd);
    if (!listing) return close(dirFd), errno;
    int err = 0;
    while (dirent* entry = readdir(listing)) {
      if (entry->d_name[0] == '.' || !wanted(entry->d_name)) continue;
      int fd = platform::openSystemPathAt(dirFd, entry->d_name);
      struct stat st;
      if (fd < 0) continue;  // a dangling link
      if (fstat(fd, &st) == 0) err = fn(fd, st);
      close(fd);
      if (err) break;
    }
    closedir(listing);
    return err;
  }

  int abi_;
  int fd_ = -1;
  uint64_t handled_ = 0;
};

int landlockABI() {
  long abi = syscall(SYS_landlock_create_ruleset, nullptr, 0, kCreateRulesetVersion);
  return abi < 0 ? 0 : static_cast<int>(abi);
}

// Variables passed through from the launcher's environment; everything
// else (LD_* above all) is left behind.
bool passedThrough(const char* entry) {
  for (const char* name : {"TERM=", "LANG=", "TZ=", "COLORTERM=", "NO_COLOR=", "LC_"})
    if (strncmp(entry, name, strlen(name)) == 0) return true;
  return false;
}

std::vector<std::string> cleanEnvironment(const std::string& home, const std::string& tmp) {
  std::vector<std::string> env;
  for (char** entry = environ; *entry; ++entry)
    if (passedThrough(*entry)) env.emplace_back(*entry);
  env.push_back("PATH=/usr/local/bin:/usr/bin:/bin");
  env.push_back("HOME=" + home);
  env.push_back("TMPDIR=" + tmp);
  env.push_back("XDG_CONFIG_HOME=" + home + "/Library/Preferences");
  env.push_back("XDG_CACHE_HOME=" + home + "/Library/Caches");
  env.push_back("XDG_DATA_HOME=" + home + "/Library/Application Support");
  env.push_back("XDG_STATE_HOME=" + home + "/Library/Application Support/State");
  return env;
}

// The system's library directories, with the multiarch ones beneath /usr/lib.
std::vector<std::string> libraryDirectories() {
  std::vector<std::string> dirs(std::begin(kLibraryDirectories), std::end(kLibraryDirectories));
  if (DIR* usrLib = opendir("/usr/lib")) {
    while (dirent* entry = readdir(usrLib))
      if (strstr(entry->d_name, "-linux-")) dirs.push_back(std::string("/usr/lib/") + entry->d_name);
    closedir(usrLib);
  }
  return dirs;
}

int run(const Options& options) {
  struct timespec launched;
  clock_gettime(CLOCK_REALTIME, &launched);
  if (geteuid() != 0)
    return fail(kExitFailure, "must be run as root: it asks quarterd for the containers, then drops to the user");
  char root[PATH_MAX] = "/";
  std::string rootOption = options.root;
  if (const char* fromEnvironment = getenv("QUARTERD_ROOT"); rootOption.empty() && fromEnvironment)
    rootOption = fromEnvironment;
  if (rootOption.empty()) {
    platform::enableHostProfile();
    platform::loadHostProfile();
  } else if (rootOption[0] != '/' || !realpath(rootOption.c_str(), root)) {
    return fail(kExitUsage, "bad device root " + rootOption);
  }
  platform::setDeviceRoot(root);

  const std::string& name = options.command.front();
  std::optional<std::string> program = resolveProgram(name);
  if (!program) return fail(kExitNotFound, "cannot find an executable " + name);
  auto account = platform::userById(*options.user);
  if (!account) return fail(kExitFailure, "no account for user " + std::to_string(*options.user));

  // The identifier must be the program's own: its entitlements name its groups.
  auto identity = platform::identityForExecutable(*program);
  const std::string registry = platform::hostPath("/etc/quarterd/identities");
  if (!identity->signingIdentifier)
    return fail(kExitFailure,
                "unknown identifier " + options.identifier + ": " + *program + " has no identity in " + registry);
  if (*identity->signingIdentifier != options.identifier)
    return fail(kExitFailure, "unknown identifier " + options.identifier + ": " + *program + " is registered as " +
                                  *identity->signingIdentifier + " in " + registry);
  struct stat programStat;
  if (stat(program->c_str(), &programStat) != 0)
    return fail(kExitCannotExecute, "cannot execute " + *program + ": " + strerror(errno));
  const FileId programId{programStat.st_dev, programStat.st_ino};
  std::set<FileId> otherPrograms;
  for (const auto& [file, identifier] : registeredFiles()) {
    // Another name of this very file could be executed as another program.
    if (file == programId && identifier != options.identifier)
      return fail(kExitFailure, *program + " is also registered as " + identifier + " under another name in " +
                                    registry + "; it cannot be confined to one identity");
    if (file != programId) otherPrograms.insert(file);
  }

  const int abi = landlockABI();
  if (abi <= 0 && !options.allowUnconfined)
    return fail(kExitFailure, "the kernel offers no Landlock (" + std::string(strerror(errno)) + "); refusing to run " +
                                  *program + " unconfined (--allow-unconfined runs it anyway)");
  if (options.noNetwork && abi < 4 && !options.allowUnconfined)
    return fail(kExitFailure, "--no-network needs Landlock ABI 4, the kernel offers " + std::to_string(abi) +
                                  " (--allow-unconfined runs it with the network)");
  if (abi <= 0 || (options.noNetwork && abi < 4))
    fprintf(stderr, "quarter-exec: warning: %s runs without %s confinement (--allow-unconfined)\n", program->c_str(),
            abi <= 0 ? "any" : "network");

  qk::UpcallRequest request;
  request.codeSignatureId = options.identifier;
  request.personaId = *options.user;
  request.containerType = 0;
  request.appGroupIds = stringsOf(identity->entitlements, "com.norvane.security.application-groups");
  request.systemGroupIds = stringsOf(identity->entitlements, "com.norvane.security.system-groups");
  if (auto system = stringsOf(identity->entitlements, "com.norvane.security.system-container"); !system.empty())
    request.systemContainerId = system.front();

  const std::string socketPath = qk::upcallSocketPath(rootOption.empty() ? "" : root);
  std::string error;
  auto client = qk::UpcallClient::connect(socketPath, &error);
  if (!client) return fail(kExitFailure, "cannot reach quarterd at " + socketPath + ": " + error);
  auto answer = client->call(request);
  client.reset();
  if (!answer) return fail(kExitFailure, "quarterd did not answer on " + socketPath);
  if (answer->returnCode != 0)
    return fail(kExitFailure, "quarterd refused the request (return code " + std::to_string(answer->returnCode) + ")");
  if (!answer->readable || answer->status.value_or(0) != 1 || !answer->dataContainer)
    return fail(kExitFailure, "quarterd could not provide every container of " + options.identifier + " for user " +
                                  std::to_string(*options.user));

  std::vector<std::string> containers{*answer->dataContainer};
  for (const auto& [group, path] : answer->groups) containers.push_back(path);
  if (answer->systemContainer) containers.push_back(*answer->systemContainer);
  for (const auto& [group, path] : answer->systemGroups) containers.push_back(path);

  Ruleset rules(abi, options.noNetwork);
  if (!rules.valid()) return fail(kExitFailure, std::string("cannot create the Landlock ruleset: ") + strerror(errno));
  for (const std::string& container : containers)
    if (int err = rules.allowContainer(container))
      return fail(kExitFailure, "cannot open up " + container + ": " + strerror(err));
  // Reading the system's files and every process's /proc entries (what the
  // kernel shows of other processes stays subject to its ptrace checks, which
  // Landlock extends to everything outside the confinement): a program's
  // children have /proc entries of their own.
  for (const char* dir : {"/usr", "/lib", "/lib64", "/lib32", "/libx32", "/bin", "/sbin", "/etc", "/proc"})
    if (int err = rules.allowSystemPath(dir, kReadRights))
      return fail(kExitFailure, std::string("cannot open up ") + dir + ": " + strerror(err));
  std::set<FileId> seen;
  ProgramDirectories kept = readKeptDirectories();
  bool keptChanged = false;
  for (const char* dir : kProgramDirectories)
    if (int err = rules.allowPrograms(dir, otherPrograms, &seen, &kept, &keptChanged, launched))
      return fail(kExitFailure, std::string("cannot open up ") + dir + ": " + strerror(err));
  if (keptChanged) writeKeptDirectories(kept);
  for (const std::string& dir : libraryDirectories())
    if (int err = rules.allowLoaders(dir.c_str(), &seen))
      return fail(kExitFailure, "cannot open up " + dir + ": " + strerror(err));
  for (const char* device : {"/dev/null", "/dev/zero", "/dev/full", "/dev/random", "/dev/urandom", "/dev/tty"})
    if (int err = rules.allowSystemPath(
            device, kReadFile | kWriteFile | (strcmp(device, "/dev/tty") ? 0ull : uint64_t{kIoctlDev})))
      return fail(kExitFailure, std::string("cannot open up ") + device + ": " + strerror(err));
  if (int err = rules.allowSystemPath(program->c_str(), kExecute | kReadFile))
    return fail(kExitFailure, "cannot open up " + *program + ": " + strerror(err));

  const std::string& home = *answer->dataContainer;
  std::vector<std::string> env = cleanEnvironment(home, answer->tempDir.value_or(home + "/tmp"));
  if (chdir(home.c_str()) != 0) return fail(kExitFailure, "cannot enter " + home + ": " + strerror(errno));

  // No set-id program may regain what is dropped here, and Landlock asks for
  // it anyway.
  if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0)
    return fail(kExitFailure, std::string("cannot set no_new_privs: ") + strerror(errno));
  if (int err = rules.restrictSelf())
    return fail(kExitFailure, std::string("cannot enforce Landlock: ") + strerror(err));
  // The protocol's users stand for host accounts of their own on a host.
  const std::optional<uid_t> uid = platform::hostUserId(*options.user);
  const std::optional<platform::HostAccount> hostAccount = platform::hostAccountFor(*options.user);
  const gid_t gid = hostAccount ? hostAccount->gid : account->gid;
  if (!uid || setgroups(1, &gid) != 0 || setresgid(gid, gid, gid) != 0 || setresuid(*uid, *uid, *uid) != 0)
    return fail(kExitFailure, "cannot drop to user " + std::to_string(*options.user) + ": " + strerror(errno));

  std::vector<char*> argv, envp;
  for (const std::string& arg : options.command) argv.push_back(const_cast<char*>(arg.c_str()));
  argv.push_back(nullptr);
  for (const std::string& entry : env) envp.push_back(const_cast<char*>(entry.c_str()));
  envp.push_back(nullptr);
  // Whatever the launcher inherited stays behind; 0, 1 and 2 are the program's.
  if (close_range(3, ~0u, CLOSE_RANGE_CLOEXEC) != 0)
    return fail(kExitFailure, std::string("cannot close inherited descriptors: ") + strerror(errno));
  execve(program->c_str(), argv.data(), envp.data());
  const int err = errno;
  return fail(err == ENOENT ? kExitNotFound : kExitCannotExecute, "cannot execute " + *program + ": " + strerror(err));
}

}  // namespace

int main(int argc, char** argv) {
  try {
    Options options = parseOptions(argc, argv);
    if (options.help) return fputs(kUsage, stdout), 0;
    if (options.version) return printf("quarter-exec %s\n", QRT_VERSION), 0;
    return run(options);
  } catch (const UsageError& e) {
    fprintf(stderr, "quarter-exec: %s\n(quarter-exec --help for usage)\n", e.message.c_str());
  } catch (const std::exception& e) { fprintf(stderr, "quarter-exec: %s\n", e.what()); }
  return kExitUsage;
}
