#include "platform/UserDatabase.h"

#include <grp.h>
#include <pwd.h>

#include <cerrno>
#include <charconv>
#include <functional>
#include <mutex>
#include <string_view>
#include <vector>

#include "platform/DeviceRoot.h"
#include "platform/HostProfile.h"

namespace platform {

namespace {

constexpr size_t kMaxSystemBuffer = 1u << 20;

bool useSystemDatabase() { return deviceRoot() == "/"; }

// ---- the system's database ----

// Calls a get*_r function with a buffer that grows while it answers ERANGE,
// and converts the record while the buffer it points into still exists.
template <typename Record, typename Call, typename Convert>
auto systemLookup(Call call, Convert convert) -> std::optional<decltype(convert(std::declval<const Record&>()))> {
  std::vector<char> buffer(1024);
  for (;;) {
    Record record{};
    Record* found = nullptr;
    int error = call(&record, buffer.data(), buffer.size(), &found);
    if (error == ERANGE && buffer.size() < kMaxSystemBuffer) {
      buffer.resize(buffer.size() * 2);
      continue;
    }
    if (error != 0 || !found) return std::nullopt;
    return convert(record);
  }
}

UserAccount accountFromPasswd(const passwd& pw) {
  return UserAccount{pw.pw_name, pw.pw_uid, pw.pw_gid, pw.pw_dir ? pw.pw_dir : ""};
}

GroupAccount accountFromGroup(const group& gr) { return GroupAccount{gr.gr_name, gr.gr_gid}; }

// ---- R/etc/passwd and R/etc/group ----

std::vector<std::string_view> splitFields(std::string_view line) {
  std::vector<std::string_view> fields;
  size_t start = 0;
  for (;;) {
    size_t colon = line.find(':', start);
    fields.push_back(line.substr(start, colon == std::string_view::npos ? std::string_view::npos : colon - start));
    if (colon == std::string_view::npos) return fields;
    start = colon + 1;
  }
}

std::optional<uint32_t> parseId(std::string_view text) {
  uint32_t value = 0;
  auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (text.empty() || error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return value;
}

// Calls visit with the fields of each line that has exactly fieldCount
// fields, until visit returns true. Comments and blank lines are skipped.
void scanDatabase(std::string_view devicePath, size_t fieldCount,
                  const std::function<bool(const std::vector<std::string_view>&)>& visit) {
  std::optional<std::string> content = readHostFile(hostPath(devicePath));
  if (!content) return;
  std::string_view rest = *content;
  while (!rest.empty()) {
    size_t newline = rest.find('\n');
    std::string_view line = rest.substr(0, newline);
    rest = newline == std::string_view::npos ? std::string_view() : rest.substr(newline + 1);
    if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
    if (line.empty() || line.front() == '#') continue;
    std::vector<std::string_view> fields = splitFields(line);
    if (fields.size() == fieldCount && !fields[0].empty() && visit(fields)) return;
  }
}

std::optional<UserAccount> findUserInFile(const std::function<bool(std::string_view, uint32_t)>& matches) {
  std::optional<UserAccount> account;
  scanDatabase("/etc/passwd", 7, [&](const std::vector<std::string_view>& f) {
    std::optional<uint32_t> uid = parseId(f[2]);
    std::optional<uint32_t> gid = parseId(f[3]);
    if (!uid || !gid || !matches(f[0], *uid)) return false;
    account = UserAccount{std::string(f[0]), *uid, *gid, f[5].empty() ? std::string() : hostPath(f[5])};
    return true;
  });
  return account;
}

}  // namespace

std::optional<UserAccount> systemUserByName(const std::string& name) {
  return systemLookup<passwd>([&](passwd* pw, char* buffer, size_t size,
                                  passwd** found) { return getpwnam_r(name.c_str(), pw, buffer, size, found); },
                              accountFromPasswd);
}

std::optional<GroupAccount> systemGroupByName(const std::string& name) {
  return systemLookup<group>([&](group* gr, char* buffer, size_t size,
                                 group** found) { return getgrnam_r(name.c_str(), gr, buffer, size, found); },
                             accountFromGroup);
}

namespace {

// The host profile's view of a system account: the accounts standing for
// protocol users carry the protocol ids; an ordinary user's containers live
// under ~/.local/share/quarterd, which stands for the device home.
std::optional<UserAccount> hostProfileView(std::optional<UserAccount> account) {
  if (!account) return std::nullopt;
  uint32_t protocol = protocolUserId(account->uid);
  if (protocol == kForeignUserId) return std::nullopt;
  if (protocol != account->uid) {
    account->uid = protocol;
    account->gid = protocol;
  } else if (!account->homeDirectory.empty()) {
    while (account->homeDirectory.size() > 1 && account->homeDirectory.back() == '/') account->homeDirectory.pop_back();
    account->homeDirectory += account->homeDirectory == "/" ? ".local/share/quarterd" : "/.local/share/quarterd";
  }
  return account;
}

}  // namespace

std::optional<UserAccount> userByName(const std::string& name) {
  if (!useSystemDatabase()) return findUserInFile([&](std::string_view entry, uint32_t) { return entry == name; });
  if (hostProfile()) return hostProfileView(systemUserByName(name));
  return systemUserByName(name);
}

std::optional<UserAccount> userById(uint32_t uid) {
  if (!useSystemDatabase()) return findUserInFile([&](std::string_view, uint32_t entry) { return entry == uid; });
  if (hostProfile()) {
    if (std::optional<HostAccount> account = hostAccountFor(uid))
      return UserAccount{account->name, uid, uid, account->homeDirectory};
    if (std::optional<uid_t> host = hostUserId(uid); !host || protocolUserId(*host) != uid) return std::nullopt;
  }
  std::optional<UserAccount> account = systemLookup<passwd>(
      [&](passwd* pw, char* buffer, size_t size, passwd** found) { return getpwuid_r(uid, pw, buffer, size, found); },
      accountFromPasswd);
  return hostProfile() ? hostProfileView(std::move(account)) : account;
}

std::optional<GroupAccount> groupByName(const std::string& name) {
  if (useSystemDatabase()) {
    // The protocol's group stands for an account of its own on a host.
    if (hostProfile() && name == "systemusers") {
      std::optional<gid_t> gid = hostSystemUsersGroup();
      if (!gid) return std::nullopt;
      return GroupAccount{kHostSystemUsersGroup, *gid};
    }
    return systemGroupByName(name);
  }
  std::optional<GroupAccount> account;
  scanDatabase("/etc/group", 4, [&](const std::vector<std::string_view>& f) {
    std::optional<uint32_t> gid = parseId(f[2]);
    if (!gid || f[0] != name) return false;
    account = GroupAccount{std::string(f[0]), *gid};
    return true;
  });
  return account;
}

std::vector<uint32_t> allUserIds() {
  std::vector<uint32_t> ids;
  if (!useSystemDatabase()) {
    scanDatabase("/etc/passwd", 7, [&](const std::vector<std::string_view>& f) {
      if (std::optional<uint32_t> uid = parseId(f[2])) ids.push_back(*uid);
      return false;
    });
    return ids;
  }
  // The enumeration's cursor is the process's own.
  static std::mutex enumeration;
  std::lock_guard hold(enumeration);
  setpwent();
  std::vector<char> buffer(16 << 10);
  passwd record{};
  passwd* found = nullptr;
  while (getpwent_r(&record, buffer.data(), buffer.size(), &found) == 0 && found) {
    uint32_t uid = hostProfile() ? protocolUserId(record.pw_uid) : record.pw_uid;
    if (uid != kForeignUserId) ids.push_back(uid);
  }
  endpwent();
  return ids;
}

uint32_t ordinaryUserMinimum() { return hostProfile() ? hostOrdinaryUserMinimum() : 501; }

}  // namespace platform
