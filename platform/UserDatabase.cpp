#include "platform/UserDatabase.h"

#include <grp.h>
#include <pwd.h>

#include <cerrno>
#include <charconv>
#include <functional>
#include <string_view>
#include <vector>

#include "platform/DeviceRoot.h"

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

std::optional<UserAccount> userByName(const std::string& name) {
  if (!useSystemDatabase())
    return findUserInFile([&](std::string_view entry, uint32_t) { return entry == name; });
  return systemLookup<passwd>(
      [&](passwd* pw, char* buffer, size_t size, passwd** found) {
        return getpwnam_r(name.c_str(), pw, buffer, size, found);
      },
      accountFromPasswd);
}

std::optional<UserAccount> userById(uint32_t uid) {
  if (!useSystemDatabase())
    return findUserInFile([&](std::string_view, uint32_t entry) { return entry == uid; });
  return systemLookup<passwd>(
      [&](passwd* pw, char* buffer, size_t size, passwd** found) {
        return getpwuid_r(uid, pw, buffer, size, found);
      },
      accountFromPasswd);
}

std::optional<GroupAccount> groupByName(const std::string& name) {
  if (useSystemDatabase()) {
    return systemLookup<group>(
        [&](group* gr, char* buffer, size_t size, group** found) {
          return getgrnam_r(name.c_str(), gr, buffer, size, found);
        },
        accountFromGroup);
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

uint32_t ordinaryUserMinimum() { return 501; }

}  // namespace platform
