#include "platform/HostProfile.h"

#include <cerrno>
#include <charconv>
#include <cstring>
#include <utility>

#include "base/QRTFormat.h"
#include "platform/DeviceRoot.h"
#include "platform/Log.h"
#include "platform/UserDatabase.h"

namespace platform {

namespace {

constexpr uint32_t kDefaultUidMin = 1000;

// Written by enableHostProfile and loadHostProfile before any other thread
// exists, read-only afterwards.
struct Profile {
  bool on = false;
  HostConfiguration configuration;
  std::optional<HostAccount> installer;
  std::optional<HostAccount> system;
  std::optional<HostAccount> defaultUser;
  std::optional<gid_t> systemUsers;
  std::optional<uint32_t> uidMin;
};

Profile& profile() {
  static Profile value;
  return value;
}

// Device path -> host path, matched on whole components.
constexpr std::pair<std::string_view, std::string_view> kPaths[] = {
    {"/private/var/containers", "/var/lib/quarterd/containers"},
    {"/private/var/root", "/var/lib/quarterd/daemon"},
    {"/private/var/emplacerd", "/var/lib/quarterd/installer"},
    {"/tmp", "/var/lib/quarterd/tmp"},
    {"/etc/device-properties.plist", "/etc/quarterd/device-properties.plist"},
    {"/etc/system-version.plist", "/etc/quarterd/system-version.plist"},
    {"/run/com.norvane.quarterd", "/run/quarterd/request.sock"},
    {"/run/com.norvane.quarterd.upcall", "/run/quarterd/upcall.sock"},
    {"/run/quarterd.lock", "/run/quarterd/lock"},
    {"/run/quarterd.fb_check", "/run/quarterd/boot-id"},
    {"/run/device", "/run/quarterd"},
    {"/run/sandbox/mappings", "/run/quarterd/mappings"},
};

std::string_view trim(std::string_view text) {
  while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) text.remove_prefix(1);
  while (!text.empty() && (text.back() == ' ' || text.back() == '\t' || text.back() == '\r')) text.remove_suffix(1);
  return text;
}

std::optional<bool> parseBoolean(std::string_view value) {
  for (std::string_view yes : {"1", "yes", "y", "true", "t", "on"})
    if (value == yes) return true;
  for (std::string_view no : {"0", "no", "n", "false", "f", "off"})
    if (value == no) return false;
  return std::nullopt;
}

template <typename T>
std::optional<T> parseUnsigned(std::string_view text) {
  T value = 0;
  auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value);
  if (text.empty() || error != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return value;
}

// Calls visit(lineNumber, line) for every line, comments and blanks skipped.
template <typename Visit>
void eachLine(std::string_view text, Visit visit) {
  for (size_t number = 1; !text.empty(); ++number) {
    size_t newline = text.find('\n');
    std::string_view line = trim(text.substr(0, newline));
    text = newline == std::string_view::npos ? std::string_view() : text.substr(newline + 1);
    if (!line.empty() && line.front() != '#' && line.front() != ';') visit(number, line);
  }
}

std::optional<HostAccount> accountNamed(const std::string& name) {
  std::optional<UserAccount> user = systemUserByName(name);
  if (!user) return std::nullopt;
  return HostAccount{user->name, user->uid, user->gid, user->homeDirectory};
}

}  // namespace

void enableHostProfile() { profile().on = true; }

bool hostProfile() { return profile().on; }

std::optional<std::string> hostProfilePath(std::string_view devicePath) {
  if (!hostProfile()) return std::nullopt;
  for (const auto& [device, host] : kPaths) {
    if (!devicePath.starts_with(device)) continue;
    std::string_view rest = devicePath.substr(device.size());
    if (!rest.empty() && rest.front() != '/') continue;
    return std::string(host) + std::string(rest);
  }
  return std::nullopt;
}

HostConfiguration parseHostConfiguration(std::string_view text, std::vector<std::string>* problems) {
  HostConfiguration configuration;
  eachLine(text, [&](size_t number, std::string_view line) {
    auto problem = [&](const std::string& what) {
      if (problems) problems->push_back(QRTFormat("%s line %zu: %s", kHostConfigurationPath, number, what.c_str()));
    };
    if (line.front() == '[') {
      if (line.back() != ']') problem("unterminated section header, line ignored");
      return;
    }
    size_t equals = line.find('=');
    if (equals == std::string_view::npos) return problem("not a key=value line, ignored");
    const std::string key(trim(line.substr(0, equals)));
    const std::string value(trim(line.substr(equals + 1)));
    auto bad = [&](const char* expected) {
      problem(QRTFormat("bad value '%s' for %s= (%s), the default is kept", value.c_str(), key.c_str(), expected));
    };
    if (key == "DefaultUser") {
      // An account name: no blanks, no colon, not a number.
      if (value.find_first_of(" \t:/") != std::string::npos || (!value.empty() && parseUnsigned<uint32_t>(value)))
        return bad("an account name");
      configuration.defaultUser = value.empty() ? std::nullopt : std::optional<std::string>(value);
    } else if (key == "InternalBuild") {
      std::optional<bool> flag = parseBoolean(value);
      if (!flag && !value.empty()) return bad("yes or no");
      configuration.internalBuild = flag;
    } else if (key == "MaxContainersPerClass") {
      std::optional<uint64_t> limit = parseUnsigned<uint64_t>(value);
      if ((!limit || *limit == 0 || *limit > UINT32_MAX) && !value.empty()) return bad("a number from 1 to 4294967295");
      configuration.maxContainersPerClass = limit;
    } else {
      problem(QRTFormat("unknown key %s=, ignored", key.c_str()));
    }
  });
  return configuration;
}

std::vector<HostProfileLine> loadHostProfile() {
  Profile& p = profile();
  std::vector<std::string> problems;
  if (std::optional<std::string> text = readHostFile(kHostConfigurationPath, 1u << 20))
    p.configuration = parseHostConfiguration(*text, &problems);
  else if (errno != ENOENT)
    problems.push_back(
        QRTFormat("Cannot read %s: %s; every key keeps its default", kHostConfigurationPath, strerror(errno)));
  p.installer = accountNamed(kHostInstallerAccount);
  p.system = accountNamed(kHostSystemAccount);
  if (std::optional<GroupAccount> group = systemGroupByName(kHostSystemUsersGroup)) p.systemUsers = group->gid;
  for (const char* name : {kHostInstallerAccount, kHostSystemAccount, kHostSystemUsersGroup}) {
    const bool found = name == kHostInstallerAccount ? p.installer.has_value()
                       : name == kHostSystemAccount  ? p.system.has_value()
                                                     : p.systemUsers.has_value();
    if (!found)
      problems.push_back(QRTFormat("No account %s: requests that need it fail (systemd-sysusers makes it)", name));
  }
  std::string defaultUser;
  if (const std::optional<std::string>& name = p.configuration.defaultUser) {
    p.defaultUser = accountNamed(*name);
    if (!p.defaultUser)
      problems.push_back(
          QRTFormat("DefaultUser=%s names no account: requests for the default user fail", name->c_str()));
    else
      defaultUser = QRTFormat("Default user is %s (uid %u)", name->c_str(), p.defaultUser->uid);
  } else {
    defaultUser = QRTFormat("No DefaultUser= in %s: requests for the default user fail", kHostConfigurationPath);
  }
  if (std::optional<std::string> defs = readHostFile("/etc/login.defs", 1u << 20))
    p.uidMin = parseLoginDefsUidMin(*defs);

  std::vector<HostProfileLine> lines;
  for (std::string& problem : problems) lines.push_back({kLogError, std::move(problem)});
  if (!defaultUser.empty()) lines.push_back({kLogNotice, std::move(defaultUser)});
  return lines;
}

const HostConfiguration& hostConfiguration() { return profile().configuration; }

std::optional<uint64_t> configuredMaxContainersPerClass() { return profile().configuration.maxContainersPerClass; }

std::optional<HostAccount> hostAccountFor(uint32_t protocolUser) {
  if (!hostProfile()) return std::nullopt;
  if (protocolUser == kInstallerUserId) return profile().installer;
  if (protocolUser == kSystemContainerUserId) return profile().system;
  return std::nullopt;
}

std::optional<HostAccount> hostDefaultUser() { return profile().defaultUser; }

std::optional<gid_t> hostSystemUsersGroup() { return profile().systemUsers; }

std::optional<uid_t> hostUserId(uint32_t protocolUser) {
  if (!hostProfile() || (protocolUser != kInstallerUserId && protocolUser != kSystemContainerUserId))
    return protocolUser;
  std::optional<HostAccount> account = hostAccountFor(protocolUser);
  if (!account) return std::nullopt;
  return account->uid;
}

std::optional<gid_t> hostGroupId(uint32_t protocolUser) {
  if (!hostProfile() || (protocolUser != kInstallerUserId && protocolUser != kSystemContainerUserId))
    return protocolUser;
  std::optional<HostAccount> account = hostAccountFor(protocolUser);
  if (!account) return std::nullopt;
  return account->gid;
}

uint32_t protocolUserId(uid_t hostUid) {
  if (!hostProfile()) return hostUid;
  const Profile& p = profile();
  if (p.installer && p.installer->uid == hostUid) return kInstallerUserId;
  if (p.system && p.system->uid == hostUid) return kSystemContainerUserId;
  if (hostUid == kInstallerUserId || hostUid == kSystemContainerUserId) return kForeignUserId;
  return hostUid;
}

uint32_t hostOrdinaryUserMinimum() { return profile().uidMin.value_or(kDefaultUidMin); }

std::optional<uint32_t> parseLoginDefsUidMin(std::string_view text) {
  std::optional<uint32_t> found;
  eachLine(text, [&](size_t, std::string_view line) {
    size_t blank = line.find_first_of(" \t");
    if (blank == std::string_view::npos || line.substr(0, blank) != "UID_MIN") return;
    found = parseUnsigned<uint32_t>(trim(line.substr(blank)));
  });
  return found;
}

}  // namespace platform
