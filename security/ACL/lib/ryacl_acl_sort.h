// Ordering the identifiers of one sub-ACL: ascending under the POSIX-locale
// case folding (A-Z onto a-z, every other byte by its unsigned value), equal
// identifiers in ascending entry number.  The writer needs this order for
// user and group sub-ACLs; the entries themselves are kept in arrival
// order (see ryacl_acl_tree.h).
#pragma once

#include <cstddef>
#include <cstdint>

// Where the sort finds identifier i: records of `stride` bytes from
// `refs` on, record i starting with two uint32_t, the offset of the text in
// `arena` and its length (a NUL follows the text).
struct acl__id_table {
    const char *arena;
    const void *refs;
    size_t stride;
};

// One identifier being ordered; the caller sets i (its entry number), the
// sort fills the rest.  Sixteen bytes, so that a pass over a million keys
// moves 16 MB, not 24.
struct acl__sort_key {
    uint64_t k;   // folded bytes [depth, depth + 8), big-endian, zero past the end
    uint32_t k2;  // the four after
    uint32_t i;   // entry number
};

// Bytes of the work area for n keys: the keys, as many again for the
// passes to move them into, then the sort's own stack.
size_t acl__sort_area_bytes(size_t n);
// Largest n whose area's size can be expressed.
size_t acl__sort_max_keys();
// Sort keys[0, n) (the start of a work area of acl__sort_area_bytes(n)
// bytes, keys[j].i set and ascending in j) into the order above.
// Allocates nothing and does not recurse.
void acl__sort_ids(acl__sort_key *keys, size_t n, const acl__id_table &ids);
