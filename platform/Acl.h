// POSIX ACLs (libacl) as the daemon builds them: the owner, group and other
// entries, named groups and the mask. Which entries a list carries is the
// caller's policy; this is only the means.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>

#include "platform/FileIO.h"

namespace platform {

// Rights of an entry; the same bits as the owner's, group's or others' in a
// mode.
inline constexpr uint32_t kAclRead = 04;
inline constexpr uint32_t kAclWrite = 02;
inline constexpr uint32_t kAclExecute = 01;

// A step that failed: the libacl call ("acl_init", ...) and its errno value.
struct AclFailure {
  const char* call = nullptr;
  int err = 0;
  explicit operator bool() const { return call != nullptr; }
};

class Acl {
 public:
  Acl() = default;
  Acl(Acl&& o) noexcept;
  Acl& operator=(Acl&& o) noexcept;
  Acl(const Acl&) = delete;
  Acl& operator=(const Acl&) = delete;
  ~Acl();
  explicit operator bool() const { return list_ != nullptr; }

  // A list with room for capacity entries and owner, group and other entries
  // that grant nothing.
  static AclFailure makeWithOwnerEntries(int capacity, Acl* out);
  // A named group's entry (permissions 0 leave it empty), then the mask
  // recomputed so that it does not cut the entry down.
  AclFailure addGroup(gid_t gid, uint32_t permissions);
  // Owner, group and other entries take their bits of mode, and the mask is
  // widened to cover them. 0 or an errno value.
  int adoptModeBits(mode_t mode);
  // A copy (0 or an errno value).
  int duplicate(Acl* out) const;
  // Sets the list as the item's access list, or its default list, through
  // the item's own descriptor entry (the inode is reached without opening
  // it). 0 or an errno value.
  int applyTo(const Item& item, bool asDefault) const;
  // The item's access list, or its default list, read the same way. 0 or an
  // errno value.
  static int readFrom(const Item& item, bool asDefault, Acl* out);
  // The entries in their short text form, in libacl's order, so that two
  // lists compare equal when their texts do; empty for no list.
  std::string text() const;

 private:
  void* list_ = nullptr;  // acl_t
};

}  // namespace platform
