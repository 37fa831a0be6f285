// ACL trees: the entries of one sub-ACL (one type and, for user and expanded
// entries, one mechanism), screened for duplicates and kept so that they can
// be laid down in order: ascending case-insensitive identifier for user and
// group entries, insertion order for expanded entries.
//
// A tree is an opaque object reached through sec_acltree_t (null while
// empty).  Inserting and finding a duplicate cost O(1) whatever the order
// of the input (deleting at most O(log n)), and nothing recurses.
#pragma once

#include <cstddef>
#include <cstdint>

#include "ryacl.h"

struct sec_acltree_s;
typedef sec_acltree_s *sec_acltree_t;

// The growable array of trees of an ACL under construction, one slot per
// sub-ACL in the order in which each sub-ACL's first entry arrived, with an
// index from (type, folded mechanism) to slot.
struct acl__trees_s {
    sec_acltree_t *trees = nullptr;
    int32_t nooftrees = 0;
    void *index = nullptr;  // owned; see ryacl_acl_tree.cpp
};

// Find or append the tree of the entry's sub-ACL and insert a copy of the
// entry, refusing a duplicate (43 with message 160, 144 or 161).
int32_t sec__add_acle_to_trees(const sec_acle_desc *acle, acl__trees_s *trees);
// Release every tree (the last first) and the array; leaves it empty.
void acl__free_trees(acl__trees_s *trees);

// Insert a copy of acle into *node (creating the tree when null).  With
// single a duplicate is refused; without, its permission replaces the stored
// one (the stored mechanism and identifier keep their case).
int32_t sec__add_acle_to_tree(sec_boolean_t single, const sec_acle_desc *acle, sec_acltree_t *node);
// Remove the entry of the same type and identifier (18, message 105, when
// absent).
int32_t sec__del_acle_from_tree(const sec_acle_desc *acle, sec_acltree_t node);
// Release a tree and every entry it still holds; null is accepted.
void sec__free_acltree(sec_acltree_t tree);
// Move the tree's entries, in order, onto the end of a list.
int32_t sec__acltree_to_aclelist(sec_acltree_t tree, sec_acle_list_t aclelist);

// Read access for serialising and dumping.
struct acl__tree_entry_view {
    uint32_t perm;
    unsigned char type;
    const char *mech;  // NUL-terminated, at most 16 characters ("" when none)
    const char *id;    // NUL-terminated, or null for types 1 and 2
    size_t idlen;      // strlen(id), 0 when none
};
unsigned char acl__tree_type(const sec_acltree_s *tree);
// Number of entries present.
size_t acl__tree_count(const sec_acltree_s *tree);
// Mechanism text the sub-ACL carries: that of the earliest inserted entry
// still present ("" when none).
const char *acl__tree_mech(const sec_acltree_s *tree);
// Visit the present entries in order; stop early when fn returns false.
// Returns 0, or 6 (message 89 recorded) when ordering needs memory that
// cannot be had.
typedef bool (*acl__tree_visit_fn)(const acl__tree_entry_view *e, void *ctx);
int32_t acl__tree_visit(sec_acltree_s *tree, acl__tree_visit_fn fn, void *ctx);
// The same, naming `fname` in message 89.
int32_t acl__tree_visit_named(sec_acltree_s *tree, acl__tree_visit_fn fn, void *ctx, const char *fname);

// Insert an entry given as parts, for reading a sub-ACL back without a
// temporary record.  mech (types 4, 8) and id (types 4, 8, 16) must be
// NUL-terminated at mechlen and idlen; they are ignored for the other
// types.  Same results as sec__add_acle_to_tree.
int32_t acl__tree_insert(sec_acltree_t *node, sec_boolean_t single, unsigned char type, uint32_t perm,
                         const char *mech, size_t mechlen, const char *id, size_t idlen);
// Make room for `entries` more entries and `bytes` more identifier bytes,
// so that a tree whose size is known grows once.  0, or 6 (message 89).
// The tree may move: *tree is updated.
int32_t acl__tree_reserve(sec_acltree_t *tree, size_t entries, size_t bytes);
// Without ordering anything: the number of present entries, the sum of
// their identifier lengths and the longest one.
void acl__tree_stats(const sec_acltree_s *tree, size_t *count, uint64_t *id_bytes, size_t *max_idlen);

// Advise the kernel that a large block is worth backing with huge pages
// (no effect on small blocks or where unsupported).
void acl__advise_large(void *p, size_t n);
