#include "DaemonFixture.h"

#include <grp.h>
#include <limits.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "base/PlistCodec.h"

plist::Dictionary request(uint64_t command, plist::Dictionary keys) {
  keys[QRTKeyCommand] = command;
  return keys;
}

uint64_t codeOf(const std::optional<plist::Dictionary>& reply) {
  const plist::Value* code = reply ? plist::find(*reply, QRTReplyKeyError) : nullptr;
  return code && code->isInteger() ? code->integer().asUnsigned() : 0;
}

plist::Data uuidData(const QRTUUID& uuid) { return plist::Data(uuid.bytes().begin(), uuid.bytes().end()); }

std::optional<plist::Value> at(const std::optional<plist::Dictionary>& reply, const char* key) {
  const plist::Value* v = reply ? plist::find(*reply, key) : nullptr;
  return v ? std::optional<plist::Value>(*v) : std::nullopt;
}

std::optional<uint64_t> u64At(const std::optional<plist::Dictionary>& reply, const char* key) {
  auto v = at(reply, key);
  return v && v->isInteger() ? std::optional<uint64_t>(v->integer().asUnsigned()) : std::nullopt;
}

std::string stringAt(const std::optional<plist::Dictionary>& reply, const char* key) {
  auto v = at(reply, key);
  return v && v->isString() ? v->string() : "";
}

plist::Dictionary byName(uint64_t user, uint64_t cls, const std::string& identifier) {
  return {{QRTKeyUserID, user}, {QRTKeyContainerClass, cls}, {QRTKeyIdentifier, identifier}};
}
plist::Dictionary byName(const Container& c) { return byName(c.user, c.cls, c.identifier); }
plist::Dictionary selector(const Container& c) { return with(byName(c), {{QRTKeyUUID, uuidData(c.uuid)}}); }
plist::Dictionary with(plist::Dictionary keys, plist::Dictionary more) { return more.merge(keys), more; }
plist::Dictionary without(plist::Dictionary keys, const std::string& key) { return keys.erase(key), keys; }

plist::Dictionary replaceKeys(const Container* old, const Container& fresh) {
  plist::Dictionary keys{{QRTKeyNewContainerUUID, uuidData(fresh.uuid)},
                         {QRTKeyNewContainerClass, fresh.cls},
                         {QRTKeyNewContainerUserID, fresh.user},
                         {QRTKeyNewIdentifier, fresh.identifier}};
  if (!old) return keys;
  return with(keys, {{QRTKeyOldContainerUUID, uuidData(old->uuid)},
                     {QRTKeyOldContainerClass, old->cls},
                     {QRTKeyOldContainerUserID, old->user},
                     {QRTKeyOldIdentifier, old->identifier}});
}

plist::Dictionary stageKeys(const Container& c) {
  return {{QRTKeyContainerClassesArray, plist::Array{c.cls}},
          {QRTKeyUserIDsArray, plist::Array{c.user}},
          {QRTKeyUUIDsArray, plist::Array{uuidData(c.uuid)}},
          {QRTKeyIdentifiersArray, plist::Array{c.identifier}}};
}

plist::Array strings(std::initializer_list<const char*> items) { return plist::Array(items.begin(), items.end()); }

void becomeUser(uid_t uid) {
  if (setgroups(0, nullptr) != 0 || setresgid(uid, uid, uid) != 0 || setresuid(uid, uid, uid) != 0) _exit(126);
}

int exitStatus(pid_t pid) {
  int status = -1;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : 255;
}

int asUser(uid_t uid, const std::function<bool()>& step, pid_t* pid) {
  pid_t child = fork();
  if (child == 0) {
    becomeUser(uid);
    _exit(step() ? 0 : 1);
  }
  if (pid) *pid = child;
  return exitStatus(child);
}

int rawConnect(const std::string& path) {
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  if (fd >= 0 && connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) return fd;
  if (fd >= 0) close(fd);
  return -1;
}

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

bool eventually(const std::function<bool()>& condition) {
  for (int i = 0; i < 1000; ++i, std::this_thread::sleep_for(std::chrono::milliseconds(10)))
    if (condition()) return true;
  return false;
}

std::string baseName(const std::string& path) { return path.substr(path.rfind('/') + 1); }
std::string parentOf(const std::string& path) { return path.substr(0, path.rfind('/')); }

std::pair<uint32_t, uint32_t> ownerAndMode(const std::string& path) {
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return {UINT32_MAX, UINT32_MAX};
  return {st.st_uid, st.st_mode & 07777};
}

void writeFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << text;
}

void writePlist(const std::string& path, const plist::Dictionary& dictionary) {
  plist::Data bytes = plist::writeBinary(dictionary);
  writeFile(path, std::string(bytes.begin(), bytes.end()));
}

std::string output(const std::string& command) {
  std::string out;
  if (FILE* pipe = popen(command.c_str(), "r")) {
    char buffer[4096];
    for (size_t n; (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) out.append(buffer, n);
    pclose(pipe);
  }
  return out;
}

std::string readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

bool exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

std::vector<std::string> listDirectory(const std::string& path) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& entry : std::filesystem::directory_iterator(path, ec)) names.push_back(entry.path().filename());
  return names;
}

std::optional<plist::Dictionary> readPlist(const std::string& path) {
  std::string data = readFile(path);
  auto value = plist::parse(data.data(), data.size());
  if (!value || !value->isDictionary()) return std::nullopt;
  return value->dictionary();
}

std::string readLink(const std::string& path) {
  std::error_code ec;
  return std::filesystem::read_symlink(path, ec).string();
}

void DaemonFixture::SetUp() {
  char tmpl[] = "/tmp/quarterd-test.XXXXXX";
  ASSERT_NE(mkdtemp(tmpl), nullptr);
  root = tmpl;
  // The daemon serves users below the root; they must be able to reach it.
  ASSERT_EQ(chmod(root.c_str(), 0755), 0);
  std::string script = std::string(QRT_TEST_SOURCE_DIR) + "/../scripts/make-device-root";
  ASSERT_EQ(system((script + " " + root).c_str()), 0);
  startDaemon();
}

void DaemonFixture::TearDown() {
  if (daemon > 0) {
    int status = stopDaemon();
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "daemon exit status " << status;
  }
  for (auto it = mounted.rbegin(); it != mounted.rend(); ++it) umount2(it->c_str(), MNT_DETACH);
  if (!root.empty() && !HasFailure()) system(("rm -rf " + root).c_str());
}

bool DaemonFixture::mountOnTmpfs(const std::string& directory, const std::string& size) {
  const std::string disk = directory + ".disk";
  stopDaemon();
  const bool done = rename(directory.c_str(), disk.c_str()) == 0 && mkdir(directory.c_str(), 0755) == 0 &&
                    mount("quarterd-test", directory.c_str(), "tmpfs", 0, ("size=" + size).c_str()) == 0;
  if (done)
    mounted.push_back(directory);
  else
    rmdir(directory.c_str());
  EXPECT_EQ(system(("cp -a " + disk + "/. " + directory + " && rm -rf " + disk).c_str()), 0);
  startDaemon();
  return done;
}

void DaemonFixture::launchDaemon() {
  daemon = fork();
  ASSERT_GE(daemon, 0);
  if (daemon == 0) {
    execl(QRT_DAEMON_PATH, QRT_DAEMON_PATH, "--root", root.c_str(), "--log-level", "7", nullptr);
    _exit(127);
  }
}

void DaemonFixture::startDaemon() {
  std::string socketPath = qk::requestSocketPath(root);
  unlink(socketPath.c_str());
  launchDaemon();
  ASSERT_TRUE(eventually([&] { return exists(socketPath); })) << "daemon socket never appeared at " << socketPath;
}

int DaemonFixture::stopDaemon(int signal) {
  int status = -1;
  if (daemon <= 0) return status;  // kill(-1) would reach every process
  kill(daemon, signal);
  waitpid(daemon, &status, 0);
  daemon = -1;
  return status;
}

void DaemonFixture::restartDaemon() {
  ASSERT_EQ(stopDaemon(), 0);
  startDaemon();
}

void DaemonFixture::expectKilledAt(const std::string& point, std::optional<uint64_t> command,
                                   const plist::Dictionary& keys) {
  writeFile(root + "/run/quarterd.crashpoint", point + "\n");
  if (!command) {
    launchDaemon();
  } else {
    if (daemon <= 0) startDaemon();
    EXPECT_FALSE(call(*command, keys)) << "the daemon answered instead of dying at " << point;
  }
  int status = 0;
  ASSERT_EQ(waitpid(daemon, &status, 0), daemon);
  EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << point << ": status " << status;
  daemon = -1;
  unlink((root + "/run/quarterd.crashpoint").c_str());
}

std::unique_ptr<qk::Connection> DaemonFixture::connect() {
  std::string error;
  auto connection = qk::Connection::connect(qk::requestSocketPath(root), &error);
  EXPECT_TRUE(connection) << error;
  return connection;
}

std::optional<plist::Dictionary> DaemonFixture::call(uint64_t command, plist::Dictionary keys) {
  auto connection = qk::Connection::connect(qk::requestSocketPath(root));
  if (!connection) return std::nullopt;
  return connection->call(request(command, std::move(keys)), std::chrono::seconds(30));
}

Container DaemonFixture::createOrLookup(uint64_t user, const std::string& identifier, uint64_t cls, bool create,
                                        bool transient, uint64_t command) {
  auto reply = call(command, {{QRTKeyUserID, user},
                              {QRTKeyContainerClass, cls},
                              {QRTKeyIdentifier, identifier},
                              {QRTKeyCreateIfNecessary, create},
                              {QRTKeyTransient, transient}});
  Container c{user, cls,  codeOf(reply), stringAt(reply, QRTReplyKeyIdentifier), stringAt(reply, QRTReplyKeyPath),
              {},   false};
  if (auto v = at(reply, QRTReplyKeyExisted); v && v->isBoolean()) c.existed = v->boolean();
  if (auto v = at(reply, QRTReplyKeyUUID); v && v->isData())
    c.uuid = QRTUUID::fromBytes(v->data().data(), v->data().size()).value_or(QRTUUID());
  return c;
}

uint64_t DaemonFixture::registerProgram(const std::string& id, const plist::Dictionary& entitlements,
                                        const plist::Dictionary& options) {
  return codeOf(call(QRTCommandProcessCodeSigningInfo,
                     {{QRTKeyIdentifier, id},
                      {"CodeSigningInfo", plist::Dictionary{{"com.norvane.QuarterKit.Entitlements", entitlements}}},
                      {"OptionsDictionary", options}}));
}

Container DaemonFixture::make(uint64_t user, const std::string& identifier, uint64_t cls, bool transient) {
  Container c = createOrLookup(user, identifier, cls, true, transient);
  EXPECT_EQ(c.error, 1u) << identifier;
  return c;
}

void DaemonFixture::setIdentity(const std::string& name, const std::string& executable,
                                const std::string& signingIdentifier, const plist::Dictionary& entitlements,
                                const plist::Array& users) {
  plist::Dictionary identity{
      {"Executable", executable}, {"SigningIdentifier", signingIdentifier}, {"Entitlements", entitlements}};
  if (!users.empty()) identity["Users"] = users;
  std::string dir = root + "/etc/quarterd/identities";
  std::string tmp = dir + "/." + name + ".tmp";
  writePlist(tmp, identity);
  chmod(tmp.c_str(), 0644);  // the daemon skips a registry file others can write
  rename(tmp.c_str(), (dir + "/" + name + ".plist").c_str());
}

void DaemonFixture::setOwnIdentity(const std::string& signingIdentifier, const plist::Dictionary& entitlements) {
  setIdentity("self", readLink("/proc/self/exe"), signingIdentifier, entitlements);
}

void DaemonFixture::clearOwnIdentity() { unlink((root + "/etc/quarterd/identities/self.plist").c_str()); }

std::string DaemonFixture::entitledQuarterctl() {
  const std::string ctl = root + "/bin/quarterctl";
  std::filesystem::create_directories(root + "/bin");
  std::filesystem::copy_file(QRT_QUARTERCTL_PATH, ctl);
  char resolved[PATH_MAX];
  EXPECT_NE(realpath(ctl.c_str(), resolved), nullptr);
  setIdentity("quarterctl", resolved, "com.norvane.quarterctl", {{QRTEntitlementAllowed, true}});
  return ctl;
}

size_t DaemonFixture::logCount(const std::string& text) const {
  const std::string log = logText();
  size_t n = 0;
  for (size_t at = log.find(text); at != std::string::npos; at = log.find(text, at + 1)) ++n;
  return n;
}

std::string DaemonFixture::logText() const {
  return readFile(root + "/private/var/root/Library/Logs/QuarterKit/quarterd.log");
}

bool DaemonFixture::logContains(const std::string& text) const {
  return eventually([&] { return contains(logText(), text); });
}
