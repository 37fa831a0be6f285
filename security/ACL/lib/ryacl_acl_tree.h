// ACL trees: the entries of one sub-ACL (one type and, for user and expanded
// entries, one mechanism), screened for duplicates and kept so that they can
// be laid down in order: ascending case-insensitive identifier for user and
// group entries, insertion order for expanded entries.
//
// The names say "tree" because that is what every caller knows them as;
// none of them is one.  A tree is an opaque object reached through
// sec_acltree_t (null while empty): its entries in arrival order in one
// array, their identifiers in one byte arena (or, for a tree built from a
// parsed text that outlives it, left in that text), and, once it grows past
// a few entries in no order, a hash index on the folded identifier
// (ryacl_acl_tree.cpp).  The trees of an ACL under construction take their
// small blocks from one pool, released with them.  A search tree costs a comparison per level and,
// fed a sorted file, becomes a chain as deep as the file is long; the
// hashed arena finds a duplicate in O(1) whatever the input order, never
// recurses, and the order the writer needs is made once, when the entries
// are visited (ryacl_acl_sort.h).  The array of trees of an ACL under
// construction (acl__trees_s) is ryacl_acl_trees.cpp.
#pragma once

#include <cstddef>
#include <cstdint>

#include "ry_zo_int.h"
#include "ryacl.h"

struct sec_acltree_s;
struct acl__entry_parts;
struct acl__pool;
typedef sec_acltree_s *sec_acltree_t;

// The growable array of trees of an ACL under construction, one slot per
// sub-ACL in the order in which each sub-ACL's first entry arrived, with an
// index from (type, folded mechanism) to slot.
struct acl__trees_s {
    sec_acltree_t *trees = nullptr;
    int32_t nooftrees = 0;
    void *index = nullptr;  // owned; see ryacl_acl_tree.cpp
    // The one text the trees' identifiers may point into (see
    // acl__parse_acltext); it must outlive them.
    const char *text = nullptr;
    // Set before the first entry, for a caller that will write the trees
    // out in order and starts over from the beginning on any failure: an
    // entry that arrives out of order is then not looked up at all, and a
    // duplicate is found when the sort for the writer puts it beside its
    // twin (acl__tree_visit fails with the duplicate's 43).  Such trees are
    // only added to, sized, visited and freed.
    bool defer_duplicates = false;
};

// Find or append the tree of the entry's sub-ACL and insert a copy of the
// entry, refusing a duplicate (43 with message 160, 144 or 161).
int32_t sec__add_acle_to_trees(const sec_acle_desc *acle, acl__trees_s *trees);
// Entries about to be added, as parts, in the order they will be: hashed,
// and what adding each will touch fetched into cache, so that the misses of
// a batch overlap instead of coming one after another.  Changes no tree.
void acl__trees_prefetch(const acl__trees_s *trees, acl__entry_parts *parts, size_t n);
// sec__add_acle_to_trees of an entry as parts (its hash kept).
int32_t acl__add_parts_to_trees(const acl__entry_parts &parts, acl__trees_s *trees);
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
// Its length, read from the tree's header alone (every spelling of one
// mechanism has the same length).
size_t acl__tree_mechlen(const sec_acltree_s *tree);
// Visit the present entries in order; stop early when fn returns false.
// Returns 0, or 6 (message 89 recorded) when ordering needs memory that
// cannot be had, or, in a tree whose duplicates were deferred, 43 with the
// duplicate's message at the second of two equal identifiers.
typedef bool (*acl__tree_visit_fn)(const acl__tree_entry_view *e, void *ctx);
int32_t acl__tree_visit(sec_acltree_s *tree, acl__tree_visit_fn fn, void *ctx);
// The same, naming `fname` in message 89.
int32_t acl__tree_visit_named(sec_acltree_s *tree, acl__tree_visit_fn fn, void *ctx, const char *fname);
// Fetch into the cache, without waiting, what sizing and visiting a tree
// read first, one step of the chain at a time: stage 0 the tree's own
// block, 1 its entries, 2 the texts of its first identifiers.  Each stage
// reads what the one before fetched, so a caller going through many trees
// calls the stages a few trees apart.  Null is accepted.
void acl__tree_visit_prefetch(const sec_acltree_s *tree, int stage);

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
// Without ordering or walking anything: the number of present entries,
// the sum of their identifier lengths, and whether any is longer than a
// compiled ACL can hold.
void acl__tree_stats(const sec_acltree_s *tree, size_t *count, uint64_t *id_bytes, bool *too_long_id);

// ---- Shared by the tree and the array of trees ---------------------------

// An entry as parts: mech NUL-terminated at mechlen and id at idlen, both
// "" for the types without them.
struct acl__entry_parts {
    unsigned char type;
    uint32_t perm;
    const char *mech;
    size_t mechlen;
    const char *id;
    size_t idlen;
    // The identifier's hash (acl__id_hash), once taken.
    mutable uint32_t idhash = 0;
    mutable bool hashed = false;
    // The slot of its tree in the array of trees, once found (a slot keeps
    // its tree for good).
    int32_t tree_slot = -1;
    // The hash of its sub-ACL's key (acl__subacl_key_hash), once taken.
    uint32_t keyhash = 0;
    bool keyhashed = false;
    // Its type and mechanism bytes are those of the entry added just
    // before it (which the parser knows at no cost): its sub-ACL is that
    // entry's, found and checked already.
    bool same_key_as_previous = false;
    // A text that holds id NUL-terminated, less than 4 GiB from its start,
    // and outlives the tree: the tree may keep id where it is.
    const char *text = nullptr;
};
// The hash the trees index an identifier by.
uint32_t acl__id_hash(const char *id, size_t idlen);
// Fetch into cache what inserting an identifier of that hash into the tree
// will touch; changes nothing.
void acl__tree_prefetch(const sec_acltree_s *tree, uint32_t idhash);
// The parts of an entry record; false for a type that is none of the five.
bool acl__entry_parts_of(const sec_acle_desc *acle, acl__entry_parts *parts);
// The same for a record the parser made, whose lengths it gave.
void acl__entry_parts_known(const sec_acle_desc &acle, size_t mechlen, size_t idlen, acl__entry_parts *parts);
// acl__tree_insert with the entry as parts, for a tree that
// acl__tree_holds has just said is the entry's (or null: a new one), its
// small blocks taken from `pool` (null: the heap).  A tree with pooled
// blocks must be freed before the pool.  `defer`: see
// acl__trees_s::defer_duplicates; a tree keeps the choice made when it
// grew past its first entry.
int32_t acl__tree_insert_held(sec_acltree_t *node, sec_boolean_t single, const acl__entry_parts &parts,
                              acl__pool *pool, bool defer = false);
// Whether the tree is that of sub-ACL (type, mechanism): the key it was
// created with, the mechanism compared case-insensitively.
bool acl__tree_holds(const sec_acltree_s *tree, unsigned char type, const char *mech, size_t mechlen);
// The hash of a sub-ACL key, and that of the key a tree was created with.
inline uint32_t acl__subacl_key_hash(unsigned char type, const char *mech, size_t mechlen) {
    return zo::fold_hash(mech, mechlen, type);
}
uint32_t acl__tree_key_hash(const sec_acltree_s *tree);
// Bytes from a tree's start that finding it reads (its header and the
// first entry's mechanism), for fetching ahead.
extern const size_t acl__tree_head_bytes;

// A slot of either hash index: a key's hash in the upper half, the number
// of what it finds (entry or tree slot) + 1 in the lower; 0 is free.  The
// two low bits of the hash are not used for the home slot, so a hash with
// flags in them (the tree's entries keep two there) still spreads.
namespace acl__slot {
inline size_t slot_of(uint32_t h, uint32_t mask) { return (h >> 2) & mask; }
inline uint64_t slot_value(uint32_t h, uint32_t i) { return (uint64_t{h} << 32) | (uint64_t{i} + 1); }
inline uint32_t slot_hash(uint64_t v) { return static_cast<uint32_t>(v >> 32); }
inline uint32_t slot_entry(uint64_t v) { return static_cast<uint32_t>(v) - 1; }
}  // namespace acl__slot
