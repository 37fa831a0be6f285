// The compiled ACL: byte layout helpers, serialising trees, reading
// sub-ACLs back, finding a sub-ACL.  Multi-byte fields are unaligned and
// little-endian; they are only ever read and written through these helpers.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>

#include "ryacl.h"
#include "ryacl_acl_tree.h"

#define ACL_BUF_TYPE 0x85
#define ACL_BUF_VERSION 1
#define ACL_BUF_HOST_ORDER 2
#define ACL_HDR_SIZE 5
#define ACL_SUBACL_HDR_SIZE 10  // without the mechanism
#define ACL_ENTRY_HDR_SIZE 7    // without the identifier
#define ACL_MAX_SUBACLS 65535u
#define ACL_MAX_IDLEN 65534u    // identifier bytes, its NUL not counted

inline uint16_t acl__load_le16(const unsigned char *p) {
    return static_cast<uint16_t>(p[0] | (p[1] << 8));
}
inline uint32_t acl__load_le32(const unsigned char *p) {
    return static_cast<uint32_t>(p[0]) | (static_cast<uint32_t>(p[1]) << 8) |
           (static_cast<uint32_t>(p[2]) << 16) | (static_cast<uint32_t>(p[3]) << 24);
}
inline void acl__store_le16(unsigned char *p, uint16_t v) {
    p[0] = static_cast<unsigned char>(v);
    p[1] = static_cast<unsigned char>(v >> 8);
}
inline void acl__store_le32(unsigned char *p, uint32_t v) {
    p[0] = static_cast<unsigned char>(v);
    p[1] = static_cast<unsigned char>(v >> 8);
    p[2] = static_cast<unsigned char>(v >> 16);
    p[3] = static_cast<unsigned char>(v >> 24);
}

// Serialise one tree into a new heap block holding one sub-ACL (*subacl must
// be null; stays null for a tree without entries).  *sublen receives its
// length.
int32_t sec__acltree_to_subacl(sec_acltree_s *tree, unsigned char **subacl, size_t *sublen);
// Serialise every tree, last slot first, into a new compiled ACL in *acl.
// Sized first and allocated once.
int32_t sec__acltrees_to_acl(const acl__trees_s *trees, sec_acl_buffer_t acl);
// Where streamed bytes go: put() receives consecutive pieces and returns 0,
// or a failure it has recorded, which ends the stream.
struct acl__byte_sink {
    int32_t (*put)(void *ctx, const unsigned char *p, size_t n);
    void *ctx;
};
// What the compiled ACL of a set of trees holds: its size in bytes and its
// number of sub-ACLs.
struct acl__acl_plan {
    size_t total;
    size_t nsub;
};
// The plan of the compiled ACL sec__acltrees_to_acl would build, with the
// same refusals.
int32_t acl__acltrees_size(const acl__trees_s *trees, acl__acl_plan *plan);
// The same bytes as sec__acltrees_to_acl, streamed through a small staging
// area instead of built whole: a compiled ACL written to a file never needs
// its full size in memory.  `plan` is that of these trees, unchanged since.
int32_t acl__acltrees_emit(const acl__trees_s *trees, const acl__acl_plan &plan, const acl__byte_sink *sink);
// Read the sub-ACL at `subacl` (with `avail` bytes up to the end of the
// block) back into a new tree; never reads past avail.
int32_t sec__subacl_to_acltree(const unsigned char *subacl, size_t avail, sec_acltree_t *tree);
// Point *subacl at the first sub-ACL of type (and, for types 4 and 8,
// mechanism without regard to case), or null.  Walks only within
// acl->length.  Always 0.
int32_t sec__find_subacl(const sec_acl_buffer_desc *acl, unsigned char type, const char *mech,
                         unsigned char **subacl);
