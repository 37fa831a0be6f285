// ACL files on disk: name resolution, reading whole, the lock step and the
// compiled ACL cache file NAME.cacl.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <cstddef>
#include <cstdint>

#include "ryacl.h"

#define ACL_FNAME_AREA 4097  // 4096 characters and the NUL
#define ACL_CACHE_SUFFIX ".cacl"
// Longest ACL file name whose cache name still fits ACL_FNAME_AREA.
#define ACL_CACHE_MAX_ACLFNAME 4089

// Resolve filename (and username's home directory) into aclfname.
int32_t sec__get_aclfname(const char *filename, const char *username, char *aclfname, uid_t *uid);
// Look a user up: user id and home directory (hdir: ACL_FNAME_AREA bytes).
int32_t sec__get_user_info(const char *uname, uid_t *uid, char *hdir);

// Read the whole file open on aclfdes into a NUL-terminated heap buffer.
// An empty file gives no buffer and size 0.  The size comes from fstat of
// the descriptor; a descriptor that is not a regular file is refused (122),
// and a file that ends before that size is a short read (126).
int32_t acl__read_acl_file(const char *aclfname, int aclfdes, char **aclfbuf, size_t *aclfsize);
// The lock step between opening and using a file: locks nothing, returns 0.
int32_t acl__lock_acl_file(const char *aclfname, int aclfdes, uint32_t flags);

// Store a compiled ACL as the cache file of aclfname, atomically, with the
// ACL file's owner, group and mode.  0 written, 1 nothing to do, 37 failure.
int32_t sec__cache_aclbuffer(const char *aclfname, const sec_acl_buffer_desc *acl,
                             sec_boolean_t force);
// The same for the compiled ACL of `trees`, streamed to the file as it is
// serialised instead of built whole in memory first.
struct acl__trees_s;
int32_t acl__cache_acltrees(const char *aclfname, const acl__trees_s *trees, sec_boolean_t force);

// ---- Test seam between file operations ----------------------------------
//
// When set, the hook is called before each file operation of the cache
// writer and of the readers, with the step's name and the path it acts on,
// so tests can swap files, plant links or stop the process at that point.
// Steps:
//   cache:stat-acl   stat of the ACL file
//   cache:open       look at the cache name (no-follow, no access needed)
//   cache:open-write open an existing cache for writing (never written)
//   cache:open-tmp   exclusive creation of a temporary name (per attempt)
//   cache:write      each write to the temporary file
//   cache:fchown, cache:fchmod, cache:fsync, cache:close
//   cache:rename     rename of the temporary over the cache name
//   cache:unlink     removal of the temporary after a failure
//   read:open        a reader opening a file (called by the readers' owners)
//   read:fstat, read:read   inside acl__read_acl_file (read: per call)
// Not exported from the shared library; tests link the static one.
typedef void (*acl__file_step_hook_t)(const char *step, const char *path);
void acl__set_file_step_hook(acl__file_step_hook_t hook);

extern std::atomic<acl__file_step_hook_t> acl__file_step_hook;

// One relaxed load when no hook is set.
inline void acl__file_step(const char *step, const char *path) {
    acl__file_step_hook_t h = acl__file_step_hook.load(std::memory_order_relaxed);
    if (h) h(step, path);
}
