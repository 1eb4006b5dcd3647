#include "platform/Acl.h"

#include <acl/libacl.h>
#include <sys/acl.h>

#include <cerrno>
#include <string>
#include <utility>

namespace platform {

static_assert(kAclRead == ACL_READ && kAclWrite == ACL_WRITE && kAclExecute == ACL_EXECUTE);

namespace {

AclFailure failed(const char* call) { return AclFailure{call, errno}; }

AclFailure setPermissions(acl_entry_t entry, uint32_t permissions) {
  acl_permset_t permset;
  if (acl_get_permset(entry, &permset) != 0) return failed("acl_get_permset");
  acl_clear_perms(permset);
  for (acl_perm_t perm : {ACL_READ, ACL_WRITE, ACL_EXECUTE}) {
    if ((permissions & perm) && acl_add_perm(permset, perm) != 0) return failed("acl_add_perm");
  }
  if (acl_set_permset(entry, permset) != 0) return failed("acl_set_permset");
  return {};
}

// libacl may move a list when it grows (acl_create_entry and acl_calc_mask
// take acl_t*), so they work on the held pointer itself.
AclFailure createEntry(void** list, acl_tag_t tag, acl_entry_t* entry) {
  acl_t raw = static_cast<acl_t>(*list);
  int result = acl_create_entry(&raw, entry);
  *list = raw;
  if (result != 0) return failed("acl_create_entry");
  if (acl_set_tag_type(*entry, tag) != 0) return failed("acl_set_tag_type");
  return {};
}

int calcMask(void** list) {
  acl_t raw = static_cast<acl_t>(*list);
  int result = acl_calc_mask(&raw);
  *list = raw;
  return result;
}

}  // namespace

Acl::Acl(Acl&& o) noexcept : list_(std::exchange(o.list_, nullptr)) {}

Acl& Acl::operator=(Acl&& o) noexcept {
  if (this != &o) {
    if (list_) acl_free(list_);
    list_ = std::exchange(o.list_, nullptr);
  }
  return *this;
}

Acl::~Acl() {
  if (list_) acl_free(list_);
}

AclFailure Acl::makeWithOwnerEntries(int capacity, Acl* out) {
  Acl list;
  list.list_ = acl_init(capacity);
  if (!list.list_) return failed("acl_init");
  for (acl_tag_t tag : {ACL_USER_OBJ, ACL_GROUP_OBJ, ACL_OTHER}) {
    acl_entry_t entry;
    if (AclFailure f = createEntry(&list.list_, tag, &entry)) return f;
  }
  *out = std::move(list);
  return {};
}

AclFailure Acl::addGroup(gid_t gid, uint32_t permissions) {
  acl_entry_t entry;
  if (AclFailure f = createEntry(&list_, ACL_GROUP, &entry)) return f;
  if (permissions != 0) {
    if (AclFailure f = setPermissions(entry, permissions)) return f;
  }
  if (acl_set_qualifier(entry, &gid) != 0) return failed("acl_set_qualifier");
  if (calcMask(&list_) != 0) return failed("acl_calc_mask");
  return {};
}

int Acl::adoptModeBits(mode_t mode) {
  acl_t raw = static_cast<acl_t>(list_);
  acl_entry_t entry;
  for (int which = ACL_FIRST_ENTRY; acl_get_entry(raw, which, &entry) == 1; which = ACL_NEXT_ENTRY) {
    acl_tag_t tag;
    if (acl_get_tag_type(entry, &tag) != 0) return errno;
    int shift = tag == ACL_USER_OBJ ? 6 : tag == ACL_GROUP_OBJ ? 3 : tag == ACL_OTHER ? 0 : -1;
    if (shift < 0) continue;
    if (AclFailure f = setPermissions(entry, (mode >> shift) & (ACL_READ | ACL_WRITE | ACL_EXECUTE))) return f.err;
  }
  return calcMask(&list_) == 0 ? 0 : errno;
}

int Acl::duplicate(Acl* out) const {
  acl_t copy = acl_dup(static_cast<acl_t>(list_));
  if (!copy) return errno;
  Acl list;
  list.list_ = copy;
  *out = std::move(list);
  return 0;
}

int Acl::applyTo(const Item& item, bool asDefault) const {
  const std::string path = itemProcPath(item);
  return acl_set_file(path.c_str(), asDefault ? ACL_TYPE_DEFAULT : ACL_TYPE_ACCESS, static_cast<acl_t>(list_)) == 0
             ? 0
             : errno;
}

int Acl::readFrom(const Item& item, bool asDefault, Acl* out) {
  const std::string path = itemProcPath(item);
  acl_t list = acl_get_file(path.c_str(), asDefault ? ACL_TYPE_DEFAULT : ACL_TYPE_ACCESS);
  if (!list) return errno;
  Acl read;
  read.list_ = list;
  *out = std::move(read);
  return 0;
}

std::string Acl::text() const {
  if (!list_) return {};
  char* raw = acl_to_any_text(static_cast<acl_t>(list_), nullptr, ',', TEXT_ABBREVIATE | TEXT_NUMERIC_IDS);
  if (!raw) return {};
  std::string out(raw);
  acl_free(raw);
  return out;
}

}  // namespace platform
