// The host profile: quarterd installed on an ordinary Linux machine (no
// --root). Device paths are placed by the FHS, the protocol's fixed users
// stand for accounts of their own, and /etc/quarterd/quarterd.conf is read.
// Everything above platform/ keeps seeing protocol paths and ids; the
// translation happens here and in the adapters that touch the system.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace platform {

// Turns the profile on; call once at start, before any thread exists and
// before any path or account is asked for. Never on with --root.
void enableHostProfile();
bool hostProfile();

// The host path of a fixed device path (or of a file below one); nothing when
// the profile has no entry for it, which leaves it where it is.
std::optional<std::string> hostProfilePath(std::string_view devicePath);

inline constexpr const char* kHostConfigurationPath = "/etc/quarterd/quarterd.conf";
inline constexpr const char* kHostInstallerAccount = "quarterd-installer";
inline constexpr const char* kHostSystemAccount = "quarterd-system";
inline constexpr const char* kHostSystemUsersGroup = "quarterd-systemusers";
// What a host account that stands for no protocol user appears as: no account.
inline constexpr uint32_t kForeignUserId = 4294967294u;

struct HostConfiguration {
  std::optional<std::string> defaultUser;
  std::optional<bool> internalBuild;
  std::optional<uint64_t> maxContainersPerClass;
};

// systemd's key=value form: '#' and ';' start comments, a [Section] header
// is allowed, blanks around the key and value are dropped and an empty value
// resets the key. Unknown keys and bad values are left at their defaults,
// each with a line in problems.
HostConfiguration parseHostConfiguration(std::string_view text, std::vector<std::string>* problems);

// Reads the configuration file and resolves the accounts by name. Returns the
// lines to log, with their levels (the log is not open yet when this runs).
struct HostProfileLine {
  int level;
  std::string text;
};
std::vector<HostProfileLine> loadHostProfile();

// The configuration loaded at start; all defaults outside the host profile.
const HostConfiguration& hostConfiguration();
// MaxContainersPerClass= when given.
std::optional<uint64_t> configuredMaxContainersPerClass();

// Protocol user -> host owner. Identity outside the host profile; for 33 and
// 499 the ids of their accounts, nothing when the account is missing. The
// group of an ordinary user is its uid, as on the device.
std::optional<uid_t> hostUserId(uint32_t protocolUser);
std::optional<gid_t> hostGroupId(uint32_t protocolUser);
// Host uid (a peer's) -> protocol user: the accounts map back to 33 and 499,
// and a host account that happens to own 33 or 499 becomes kForeignUserId.
uint32_t protocolUserId(uid_t hostUid);

// The host account standing for a protocol user (33, 499), with its uid and
// gid as found on the host; nothing for any other user or when missing.
struct HostAccount {
  std::string name;
  uid_t uid = 0;
  gid_t gid = 0;
  std::string homeDirectory;
};
std::optional<HostAccount> hostAccountFor(uint32_t protocolUser);
// The default user's account (DefaultUser=); nothing when unset or missing.
std::optional<HostAccount> hostDefaultUser();
// The gid of quarterd-systemusers.
std::optional<gid_t> hostSystemUsersGroup();

// The first uid of an ordinary user: UID_MIN of /etc/login.defs, 1000 when
// unset or unreadable.
uint32_t hostOrdinaryUserMinimum();
// Parses login.defs text for UID_MIN.
std::optional<uint32_t> parseLoginDefsUidMin(std::string_view text);

}  // namespace platform
