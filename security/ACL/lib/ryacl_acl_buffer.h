// The compiled ACL: serialising trees, reading sub-ACLs back, finding a
// sub-ACL.  The layout's constants and field helpers are in the cursor's
// header.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>

#include "ryacl.h"
#include "ryacl_acl_cursor.h"
#include "ryacl_acl_tree.h"

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
// Read the sub-ACL at `subacl` back into a new tree, its entries located by
// count and identifier lengths within the `avail` bytes given (its room);
// its length field is not consulted.  *used (when given) receives the bytes
// its header and entries take.
int32_t sec__subacl_to_acltree(const unsigned char *subacl, size_t avail, sec_acltree_t *tree,
                               size_t *used = nullptr);
// Point *subacl at the first sub-ACL of type (and, for types 4 and 8,
// mechanism without regard to case), or null.  Always 0.
int32_t sec__find_subacl(const sec_acl_buffer_desc *acl, unsigned char type, const char *mech,
                         unsigned char **subacl);
// The same search, handing back what the cursor knows of the sub-ACL found.
bool acl__find_subacl(const sec_acl_buffer_desc *acl, unsigned char type, const char *mech,
                      acl__subacl *found);
