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
    return acl__no_memory(fname, n > INT32_MAX ? INT32_MAX : static_cast<int32_t>(n));
}

struct trees_index {
    uint64_t *slots;  // key hash (upper half), tree slot + 1 (lower half); 0 free
    uint32_t mask;
    uint32_t used;
    size_t cap;   // capacity of the trees array
    int32_t last; // slot of the previous insertion, checked first
    uint32_t last_hash;  // its key's hash
    acl__pool pool;      // the trees' small blocks
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

// The first index slot whose key hash is h: the slot of the tree of that
// key, unless two keys share a hash; -1 when none.  Reads the index only.
int32_t candidate(const trees_index *x, uint32_t h) {
    for (size_t s = slot_of(h, x->mask); x->slots[s]; s = (s + 1) & x->mask)
        if (slot_hash(x->slots[s]) == h) return static_cast<int32_t>(slot_entry(x->slots[s]));
    return -1;
}

// The slot of the tree of (type, mech), or -1; changes nothing.
int32_t find_tree(const acl__trees_s *trees, const trees_index *x, const acl__entry_parts &ne, uint32_t h) {
    if (x->last >= 0 && x->last < trees->nooftrees && h == x->last_hash &&
        acl__tree_holds(trees->trees[x->last], ne.type, ne.mech, ne.mechlen))
        return x->last;
    if (!x->slots) return -1;
    for (size_t s = slot_of(h, x->mask); x->slots[s]; s = (s + 1) & x->mask) {
        if (slot_hash(x->slots[s]) != h) continue;
        const int32_t slot = static_cast<int32_t>(slot_entry(x->slots[s]));
        if (acl__tree_holds(trees->trees[slot], ne.type, ne.mech, ne.mechlen)) return slot;
    }
    return -1;
}

}  // namespace

void acl__trees_prefetch(const acl__trees_s *trees, acl__entry_parts *parts, size_t n) {
    constexpr size_t kMax = 64;
    uint32_t keys[kMax];
    if (n > kMax) n = kMax;
    // Deferred duplicates need no identifier's hash (a new tree takes its
    // first one when it is created).
    if (!(trees && trees->defer_duplicates))
        for (size_t k = 0; k < n; ++k)
            if (acl__type_has_id(parts[k].type)) {
                parts[k].idhash = acl__id_hash(parts[k].id, parts[k].idlen);
                parts[k].hashed = true;
            }
    const auto *x = trees ? static_cast<const trees_index *>(trees->index) : nullptr;
    if (!x || !x->slots) return;
    // Each step reads what the step before fetched, for the whole batch at
    // once, so that the batch's misses overlap at every step: the index
    // slot of the entry's sub-ACL, the array slot, the tree's block, what
    // the insertion reads in the tree.  The tree found is a hint, checked
    // when the entry is added (two keys may share a hash).
    for (size_t k = 0; k < n; ++k) {
        keys[k] = k > 0 && parts[k].same_key_as_previous
                      ? keys[k - 1]
                      : acl__subacl_key_hash(parts[k].type, parts[k].mech, parts[k].mechlen);
        parts[k].keyhash = keys[k];
        parts[k].keyhashed = true;
        if (k == 0 || keys[k] != keys[k - 1]) __builtin_prefetch(&x->slots[slot_of(keys[k], x->mask)]);
    }
    for (size_t k = 0; k < n; ++k) {
        parts[k].tree_slot = k > 0 && keys[k] == keys[k - 1] ? parts[k - 1].tree_slot : candidate(x, keys[k]);
        if (parts[k].tree_slot >= 0) __builtin_prefetch(&trees->trees[parts[k].tree_slot]);
    }
    for (size_t k = 0; k < n; ++k)
        if (parts[k].tree_slot >= 0) {
            // The header, and the first entry's mechanism behind it (at
            // most acl__tree_head_bytes on, wherever the block starts).
            const char *t = reinterpret_cast<const char *>(trees->trees[parts[k].tree_slot]);
            for (size_t off = 0; off < acl__tree_head_bytes; off += 64) __builtin_prefetch(t + off);
            __builtin_prefetch(t + acl__tree_head_bytes - 1);
        }
    for (size_t k = 0; k < n; ++k)
        if (parts[k].tree_slot >= 0) acl__tree_prefetch(trees->trees[parts[k].tree_slot], parts[k].idhash);
}

int32_t sec__add_acle_to_trees(const sec_acle_desc *acle, acl__trees_s *trees) {
    if (!acle) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__add_acle_to_trees", 1, 0);
    acl__entry_parts ne;
    if (!acl__entry_parts_of(acle, &ne)) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::BAD_ACLE_TYPE, acle->type);
    return acl__add_parts_to_trees(ne, trees);
}

int32_t acl__add_parts_to_trees(const acl__entry_parts &ne, acl__trees_s *trees) {
    const char *fname = "sec__add_acle_to_trees";
    if (!trees) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, fname, 2, 0);
    if (!acl__valid_type(ne.type)) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::BAD_ACLE_TYPE, ne.type);

    auto *x = static_cast<trees_index *>(trees->index);
    if (!x) {
        x = static_cast<trees_index *>(acl__calloc(1, sizeof(trees_index)));
        if (!x) return no_memory(fname, sizeof(trees_index));
        x->cap = static_cast<size_t>(trees->nooftrees);  // an array handed in holds exactly its count
        x->last = -1;
        trees->index = x;
    }
    // Index every tree before the first search (the array may have been
    // handed in already filled).
    if (!x->slots && trees->nooftrees > 0)
        if (int32_t rc = index_room(x, trees, 0)) return rc;
    const uint32_t h = ne.keyhashed ? ne.keyhash : acl__subacl_key_hash(ne.type, ne.mech, ne.mechlen);
    // The previous entry's tree, where this one's key is byte for byte the
    // previous one's, needs no second look.
    const bool as_previous = ne.same_key_as_previous && ne.tree_slot == x->last && h == x->last_hash;
    const int32_t found = ne.tree_slot >= 0 && ne.tree_slot < trees->nooftrees &&
                                  (as_previous ||
                                   acl__tree_holds(trees->trees[ne.tree_slot], ne.type, ne.mech, ne.mechlen))
                              ? ne.tree_slot
                              : find_tree(trees, x, ne, h);
    if (found >= 0) {
        x->last = found;
        x->last_hash = h;
        return acl__tree_insert_held(&trees->trees[found], 1, ne, &x->pool, trees->defer_duplicates);
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
    int32_t rc = acl__tree_insert_held(&trees->trees[slot], 1, ne, &x->pool, trees->defer_duplicates);
    if (rc) return rc;
    index_put(x, slot_value(h, static_cast<uint32_t>(slot)));
    ++x->used;
    x->last = slot;
    x->last_hash = h;
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
        acl__pool_release(&x->pool);  // after the trees whose blocks it holds
        std::free(x->slots);
        std::free(x);
    }
    trees->trees = nullptr;
    trees->index = nullptr;
    trees->text = nullptr;
}

