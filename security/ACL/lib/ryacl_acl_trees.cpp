// The array of sub-ACL trees of an ACL under construction: one slot per
// (type, mechanism) in the order each first arrived, found through a hash
// index on the type and the folded mechanism, so that a file of many
// mechanisms costs what one of a single mechanism does.
#include <cstdlib>

#include "ryacl_acl_entry.h"
#include "ryacl_acl_tree.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"

namespace {

using acl__slot::slot_entry;
using acl__slot::slot_hash;
using acl__slot::slot_of;
using acl__slot::slot_value;

int32_t no_memory(const char *fname, size_t n) {
    return acl::set_error(ACL_RC_NO_MEMORY, 89, fname, n > INT32_MAX ? INT32_MAX : static_cast<int32_t>(n));
}

struct trees_index {
    uint64_t *slots;  // key hash (upper half), tree slot + 1 (lower half); 0 free
    uint32_t mask;
    uint32_t used;
    size_t cap;   // capacity of the trees array
    int32_t last; // slot of the previous insertion, checked first
};

void index_put(trees_index *x, uint64_t v) {
    size_t s = slot_of(slot_hash(v), x->mask);
    while (x->slots[s]) s = (s + 1) & x->mask;
    x->slots[s] = v;
}

// Make the index hold every tree of the array plus `more`, at most half
// full.
int32_t index_room(trees_index *x, acl__trees_s *trees, size_t more) {
    size_t slots = x->slots ? size_t{x->mask} + 1 : 0;
    size_t need = size_t{x->used} + more;
    if (x->slots && need <= slots / 2) return 0;
    if (!x->slots) need = static_cast<size_t>(trees->nooftrees) + more;
    size_t ns = slots ? slots : 16;
    while (ns / 2 < need) ns *= 2;
    auto *nsl = static_cast<uint64_t *>(acl__calloc(ns, sizeof(uint64_t)));
    if (!nsl) return no_memory("sec__add_acle_to_trees", ns * sizeof(uint64_t));
    acl__advise_large(nsl, ns * sizeof(uint64_t));
    uint64_t *old = x->slots;
    x->slots = nsl;
    x->mask = static_cast<uint32_t>(ns - 1);
    if (old) {
        for (size_t s = 0; s < slots; ++s)
            if (old[s]) index_put(x, old[s]);
        std::free(old);
        return 0;
    }
    x->used = 0;
    for (int32_t s = 0; s < trees->nooftrees; ++s)
        if (const sec_acltree_s *t = trees->trees[s]) {
            index_put(x, slot_value(acl__tree_key_hash(t), static_cast<uint32_t>(s)));
            ++x->used;
        }
    return 0;
}

}  // namespace

int32_t sec__add_acle_to_trees(const sec_acle_desc *acle, acl__trees_s *trees) {
    const char *fname = "sec__add_acle_to_trees";
    if (!acle) return acl::set_error(ACL_RC_BAD_ARGS, 88, fname, 1, 0);
    if (!trees) return acl::set_error(ACL_RC_BAD_ARGS, 88, fname, 2, 0);
    acl__entry_parts ne;
    if (!acl__entry_parts_of(acle, &ne)) return acl::set_error(ACL_RC_BAD_ACLE, 103, acle->type);

    auto *x = static_cast<trees_index *>(trees->index);
    if (!x) {
        x = static_cast<trees_index *>(acl__calloc(1, sizeof(trees_index)));
        if (!x) return no_memory(fname, sizeof(trees_index));
        x->cap = static_cast<size_t>(trees->nooftrees);  // an array handed in holds exactly its count
        x->last = -1;
        trees->index = x;
    }
    if (x->last >= 0 && x->last < trees->nooftrees &&
        acl__tree_holds(trees->trees[x->last], ne.type, ne.mech, ne.mechlen))
        return acl__tree_insert_parts(&trees->trees[x->last], 1, ne);
    // Index every tree before the first search (the array may have been
    // handed in already filled).
    if (!x->slots && trees->nooftrees > 0)
        if (int32_t rc = index_room(x, trees, 0)) return rc;

    const uint32_t h = acl__subacl_key_hash(ne.type, ne.mech, ne.mechlen);
    if (x->slots) {
        for (size_t s = slot_of(h, x->mask); x->slots[s]; s = (s + 1) & x->mask) {
            if (slot_hash(x->slots[s]) != h) continue;
            int32_t slot = static_cast<int32_t>(slot_entry(x->slots[s]));
            if (acl__tree_holds(trees->trees[slot], ne.type, ne.mech, ne.mechlen)) {
                x->last = slot;
                return acl__tree_insert_parts(&trees->trees[slot], 1, ne);
            }
        }
    }

    // A new sub-ACL: grow the index and the array first, so a failure
    // leaves both as they were.
    if (trees->nooftrees == INT32_MAX) return no_memory(fname, SIZE_MAX);
    if (int32_t rc = index_room(x, trees, 1)) return rc;
    if (static_cast<size_t>(trees->nooftrees) == x->cap) {
        size_t nc = x->cap ? x->cap * 2 : 4;
        if (nc > INT32_MAX) nc = INT32_MAX;
        void *na = acl__realloc(trees->trees, nc * sizeof(sec_acltree_t));
        if (!na) return no_memory(fname, nc * sizeof(sec_acltree_t));
        trees->trees = static_cast<sec_acltree_t *>(na);
        x->cap = nc;
        acl__advise_large(na, nc * sizeof(sec_acltree_t));
    }
    const int32_t slot = trees->nooftrees++;
    trees->trees[slot] = nullptr;
    // When the first entry cannot be stored the slot stays, counted and
    // empty, and out of the index.
    int32_t rc = acl__tree_insert_parts(&trees->trees[slot], 1, ne);
    if (rc) return rc;
    index_put(x, slot_value(h, static_cast<uint32_t>(slot)));
    ++x->used;
    x->last = slot;
    return 0;
}

void acl__free_trees(acl__trees_s *trees) {
    if (!trees) return;
    while (trees->nooftrees > 0) {
        --trees->nooftrees;
        sec__free_acltree(trees->trees[trees->nooftrees]);
    }
    std::free(trees->trees);
    if (auto *x = static_cast<trees_index *>(trees->index)) {
        std::free(x->slots);
        std::free(x);
    }
    trees->trees = nullptr;
    trees->index = nullptr;
}

