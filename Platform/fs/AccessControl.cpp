#include "Platform/fs/AccessControl.h"

#include <fcntl.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <memory>
#include <span>

#include "Platform/base/FileDescriptor.h"
#include "Platform/fs/OpenBeneath.h"

namespace platform {
namespace {

struct ACLDeleter {
  void operator()(void* acl) const { ::acl_free(acl); }
};
using ACL = std::unique_ptr<std::remove_pointer_t<acl_t>, ACLDeleter>;

constexpr acl_perm_t kRead = ACL_READ;
constexpr acl_perm_t kWrite = ACL_WRITE;
constexpr acl_perm_t kSearch = ACL_EXECUTE;
constexpr acl_perm_t kAll = kRead | kWrite | kSearch;
constexpr acl_perm_t kListAndSearch = kRead | kSearch;
constexpr acl_perm_t kNothing = 0;

struct Entry {
  acl_tag_t tag;
  acl_perm_t permissions;
};

// The named group (ACL_GROUP) has everything in all of them.
constexpr Entry kTopLevelAccess[] = {{ACL_USER_OBJ, kAll},
                                     {ACL_GROUP_OBJ, kListAndSearch},
                                     {ACL_GROUP, kAll},
                                     {ACL_MASK, kAll},
                                     {ACL_OTHER, kListAndSearch}};
constexpr Entry kInnerAccess[] = {{ACL_USER_OBJ, kNothing},
                                  {ACL_GROUP_OBJ, kNothing},
                                  {ACL_GROUP, kAll},
                                  {ACL_MASK, kAll},
                                  {ACL_OTHER, kNothing}};
constexpr Entry kDefault[] = {{ACL_USER_OBJ, kAll},
                              {ACL_GROUP_OBJ, kNothing},
                              {ACL_GROUP, kAll},
                              {ACL_MASK, kAll},
                              {ACL_OTHER, kNothing}};

std::unexpected<ACLFailure> failed(std::string call, acl_perm_t permissions = kNothing) {
  return std::unexpected(ACLFailure{std::move(call), Errno{errno}, permissions});
}

ACLResult<void> addEntry(acl_t* acl, const Entry& wanted, gid_t group) {
  acl_entry_t entry = nullptr;
  acl_permset_t permissions = nullptr;
  if (::acl_create_entry(acl, &entry) != 0) return failed("acl_create_entry");
  if (::acl_set_tag_type(entry, wanted.tag) != 0) return failed("acl_set_tag_type");
  if (wanted.tag == ACL_GROUP && ::acl_set_qualifier(entry, &group) != 0) {
    return failed("acl_set_qualifier");
  }
  if (::acl_get_permset(entry, &permissions) != 0) return failed("acl_get_permset");
  for (const acl_perm_t one : {kRead, kWrite, kSearch}) {
    if ((wanted.permissions & one) == 0) continue;
    if (::acl_add_perm(permissions, one) != 0) return failed("acl_add_perm", one);
  }
  if (::acl_set_permset(entry, permissions) != 0) return failed("acl_set_permset");
  return {};
}

ACLResult<ACL> build(std::span<const Entry> entries, gid_t group) {
  acl_t acl = ::acl_init(static_cast<int>(entries.size()));
  if (acl == nullptr) return failed("acl_init");
  ACLResult<void> added;
  for (const Entry& entry : entries) {
    if (added) added = addEntry(&acl, entry, group);  // may move the list
  }
  ACL owned(acl);
  if (!added) return std::unexpected(added.error());
  return owned;
}

ACLResult<void> apply(const std::string& path, acl_type_t type, std::span<const Entry> entries,
                      gid_t group) {
  const auto acl = build(entries, group);
  if (!acl) return std::unexpected(acl.error());
  if (::acl_set_file(path.c_str(), type, acl->get()) != 0) return failed({});
  return {};
}

}  // namespace

ACLResult<void> setACL(int parent, const std::string& name, ACLShape shape, gid_t group) {
  const FileDescriptor item(::openat(parent, name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (!item.valid()) return failed({});
  return setACL(item.get(), shape, group);
}

ACLResult<void> setACL(int item, ACLShape shape, gid_t group) {
  struct stat status{};
  if (::fstat(item, &status) != 0) return failed({});
  const bool isFileShape = shape == ACLShape::file;
  if (S_ISLNK(status.st_mode)) return std::unexpected(ACLFailure{{}, Errno{ELOOP}, kNothing});
  if (S_ISDIR(status.st_mode) == isFileShape) {
    return std::unexpected(ACLFailure{{}, Errno{isFileShape ? EISDIR : ENOTDIR}, kNothing});
  }
  const std::string path = linkToDescriptor(item);
  const bool isTopLevel = shape == ACLShape::topLevelDirectory;
  const auto access = isTopLevel ? std::span<const Entry>(kTopLevelAccess) : kInnerAccess;
  const auto applied = apply(path, ACL_TYPE_ACCESS, access, group);
  if (!applied || isFileShape) return applied;
  return apply(path, ACL_TYPE_DEFAULT, kDefault, group);
}

Result<void> restoreInheritedACL(int directory) {
  if (::fgetxattr(directory, "system.posix_acl_default", nullptr, 0) < 0) {
    if (errno == ENODATA || errno == ENOTSUP) return {};
    return lastErrno();
  }
  const ACL access(::acl_get_fd(directory));
  if (!access) return lastErrno();
  acl_t acl = access.get();
  if (::acl_calc_mask(&acl) != 0) return lastErrno();
  if (::acl_set_fd(directory, acl) != 0) return lastErrno();
  return {};
}

}  // namespace platform
