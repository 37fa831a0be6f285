// ACL files on disk: name resolution, reading whole, the lock step and the
// compiled ACL cache file NAME.cacl.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>

#include "ryacl.h"

#define ACL_FNAME_AREA 4097  // 4096 characters and the NUL
#define ACL_CACHE_SUFFIX ".cacl"

// Resolve filename (and username's home directory) into aclfname.
int32_t sec__get_aclfname(const char *filename, const char *username, char *aclfname, uid_t *uid);
// Look a user up: user id and home directory (hdir: ACL_FNAME_AREA bytes).
int32_t sec__get_user_info(const char *uname, uid_t *uid, char *hdir);

// Read the whole file open on aclfdes into a NUL-terminated heap buffer.
// An empty file gives no buffer and size 0.
int32_t acl__read_acl_file(const char *aclfname, int aclfdes, char **aclfbuf, size_t *aclfsize);
// The lock step between opening and using a file: locks nothing, returns 0.
int32_t acl__lock_acl_file(const char *aclfname, int aclfdes, uint32_t flags);

// Store a compiled ACL as the cache file of aclfname, atomically, with the
// ACL file's owner, group and mode.  0 written, 1 nothing to do, 37 failure.
int32_t sec__cache_aclbuffer(const char *aclfname, const sec_acl_buffer_desc *acl,
                             sec_boolean_t force);
