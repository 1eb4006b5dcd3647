// Users and groups: R/etc/passwd and R/etc/group under a device root other
// than "/" (read on every look-up, so tests can edit them live), else the
// system's own database. Home directories are host paths. In the host
// profile (HostProfile.h) ids are protocol ids, and a home is the base of the
// user's quarterd tree (~/.local/share/quarterd).
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace platform {

// The unprivileged nobody id: owner of the sub-directories of system
// containers.
inline constexpr uint32_t kNobodyUserId = 4294967294u;
// The two service users of the protocol: the installer, owner of the bundle
// containers, and the owner of the system containers. The host profile maps
// them to host accounts.
inline constexpr uint32_t kInstallerUserId = 33;
inline constexpr uint32_t kSystemContainerUserId = 499;

struct UserAccount {
  std::string name;
  uint32_t uid = 0;
  uint32_t gid = 0;
  std::string homeDirectory;  // host path
};

struct GroupAccount {
  std::string name;
  uint32_t gid = 0;
};

std::optional<UserAccount> userByName(const std::string& name);
std::optional<UserAccount> userById(uint32_t uid);
std::optional<GroupAccount> groupByName(const std::string& name);

// Every user's id, as userById takes it (start-up's sweep over users' trees).
std::vector<uint32_t> allUserIds();

// The lowest uid of an ordinary (human) user; anything below is the system's
// or a service's: 501 on a device root, UID_MIN of /etc/login.defs on a host.
uint32_t ordinaryUserMinimum();

// The system's own database, untranslated.
std::optional<UserAccount> systemUserByName(const std::string& name);
std::optional<GroupAccount> systemGroupByName(const std::string& name);

}  // namespace platform
