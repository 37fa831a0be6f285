// One sub-ACL's entries (an "ACL tree", see ryacl_acl_tree.h): the arena,
// the hash index, insertion, deletion and the ordered visit.  A tree keeps
// the entries of one sub-ACL in insertion order in
// a compact array, their identifiers (and any mechanism spelling that
// differs from the first entry's) in one byte arena, and finds duplicates
// without comparing along a path: while identifiers arrive in one
// direction (a sorted or reverse-sorted file, a sub-ACL read back) only
// the previous entry can be a duplicate; a small unordered tree scans its
// entries' hashes; a larger one keeps an open-addressing index on the
// case-folded identifier.  Nothing recurses, so a file sorted by
// identifier (which degenerates an unbalanced search tree into a chain)
// costs what a shuffled one does.
//
// The order a writer needs is produced only when entries are visited:
// insertion order for expanded entries, ascending case-insensitive
// identifier for user and group entries (ryacl_acl_sort.cpp).  An ascending tree is walked
// forwards, a descending one backwards; otherwise only the part after the
// ascending prefix is sorted and merged in, so one entry added to a tree
// read back costs a walk, not a sort.
//
// A tree that has only ever held one entry keeps it inline in a single
// heap block: an ACL whose every entry has its own mechanism is a million
// one-entry trees, and several blocks each would blow the memory budget.
#include "ryacl_acl_tree.h"

#include <bit>
#include <cstddef>
#include <cstdlib>
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl_acl_cursor.h"
#include "ryacl_acl_entry.h"
#include "ryacl_alloc.h"
#include "ryacl_acl_sort.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

struct sec_acltree_s {
    struct ent {
        uint32_t id_off;  // identifier (NUL-terminated) in the arena
        uint32_t id_len;
        uint32_t perm;
        uint32_t flags;  // kPresent, kOwnMech; above them the folded identifier's hash
    };
    struct big_part {
        ent *ents;
        char *arena;
        // A slot holds the identifier's hash (upper half) and its entry's
        // index + 1 (lower half); 0 is free, and a probe for a new
        // identifier touches the index alone.  Built only once the
        // identifiers stop arriving in one direction in a tree too large to
        // scan: until then a duplicate could only be the previous entry.
        uint64_t *idx;
        uint32_t n, cap;
        uint32_t arena_len, arena_cap;
        uint32_t idx_mask, idx_used;
        uint32_t n_present;
        uint32_t sorted_upto;  // entries [0, sorted_upto) ascend strictly
        uint32_t first_live;   // no present entry before it; only moves forward
        // The present entries' identifier bytes (they lie in an arena or a
        // text of under 4 GiB), and how many of them are longer than a
        // compiled ACL can hold: a sub-ACL is sized without a walk.
        uint32_t id_bytes;
        uint64_t last_key;     // order_key of the latest entry's identifier
        bool descending;       // every entry so far descends strictly
        // The arena is the text the entries were parsed from, which the
        // tree does not own (arena_len and arena_cap are then 0): a
        // million identifiers are not copied and their pages not touched
        // again.  An entry from anywhere else ends it (unborrow).
        bool borrowed;
        bool ents_pooled;  // ents is a block of the trees' pool
        // Duplicates deferred (acl__trees_s::defer_duplicates): an entry
        // out of order is appended unlooked-at and without its hash, and no
        // index is ever built; the ordered visit finds a duplicate beside
        // its twin.  User and group trees only: they are the sorted ones.
        bool defer_dups;
        uint32_t n_long;
    };

    // Null while the tree holds only the entry it was created with; then
    // it points just behind this header, in the same block, so an
    // insertion reaches the tree's counters without another miss.
    big_part *big;
    ent e0;  // that entry, while big is null
    unsigned char type;
    unsigned char mechlen;  // length of mech0
    // e0's identifier came from a text the trees borrow from, at e0_text_off
    // (its inline copy serves until the tree grows).
    bool e0_in_text;
    bool pooled;  // this block is the trees' pool's
    uint32_t e0_text_off;
    // Followed in the same block by the big_part (once there is one), then
    // mech0 (the first entry's mechanism spelling, "" for types without
    // one) and its NUL, then, while big is null, the first entry's
    // identifier and its NUL.
};

namespace {

using tree = sec_acltree_s;
using ent = sec_acltree_s::ent;
using big_part = sec_acltree_s::big_part;

constexpr uint32_t kPresent = 1u;
constexpr uint32_t kOwnMech = 2u;  // mechanism spelling stored just before the identifier
constexpr uint32_t kHashMask = ~3u;
// An unordered tree of up to this many entries finds duplicates by
// scanning its entries' hashes; beyond it an index pays.
constexpr uint32_t kScanMax = 16;
constexpr size_t kMechMax = 16;

char *inline_bytes(tree *t) {
    return reinterpret_cast<char *>(t) + sizeof(tree) + (t->big ? sizeof(big_part) : 0);
}
const char *inline_bytes(const tree *t) {
    return reinterpret_cast<const char *>(t) + sizeof(tree) + (t->big ? sizeof(big_part) : 0);
}

int32_t size_arg(size_t n) { return n > INT32_MAX ? INT32_MAX : static_cast<int32_t>(n); }

int32_t no_memory(const char *fname, size_t n) {
    return acl__no_memory(fname, size_arg(n));
}

bool has_id(unsigned t) { return acl__type_has_id(t); }
bool has_mech(unsigned t) { return acl__type_has_mech(t); }
bool sorted_type(unsigned t) { return t == SEC_ACLE_TYPE_USER || t == SEC_ACLE_TYPE_GROUP; }

// ---- Case folding ----------------------------------------------------------
// The order and equality of zo_strcasecmp_posix_1: A-Z fold onto a-z, every
// other byte compares as its unsigned value.

using zo::fold_eq;
using zo::fold_hash;

using acl__slot::slot_entry;
using acl__slot::slot_hash;
using acl__slot::slot_of;
using acl__slot::slot_value;

// ---- Reading entries ---------------------------------------------------------

struct tview {
    ent *ents;
    char *arena;
    uint32_t n;
};

tview view_of(tree *t) {
    if (t->big) return {t->big->ents, t->big->arena, t->big->n};
    return {&t->e0, inline_bytes(t), 1};
}

uint32_t present_count(const tree *t) {
    if (t->big) return t->big->n_present;
    return (t->e0.flags & kPresent) ? 1 : 0;
}

const char *entry_mech(const tree *t, const tview &v, const ent &e) {
    if (e.flags & kOwnMech) return v.arena + e.id_off - t->mechlen - 1;
    return inline_bytes(t);
}

// Index of the earliest inserted entry still present, or n.
uint32_t first_present(tree *t) {
    if (!t->big) return (t->e0.flags & kPresent) ? 0 : 1;
    big_part *b = t->big;
    while (b->first_live < b->n && !(b->ents[b->first_live].flags & kPresent)) ++b->first_live;
    return b->first_live;
}

bool too_long(uint32_t idlen) { return idlen > ACL_MAX_IDLEN; }

void mark_removed(tree *t, ent &e) {
    if (!(e.flags & kPresent)) return;
    e.flags &= ~kPresent;
    if (big_part *b = t->big) {
        --b->n_present;
        b->id_bytes -= e.id_len;
        b->n_long -= too_long(e.id_len);
    }
}

acl__tree_entry_view make_view(const tree *t, const tview &v, const ent &e) {
    acl__tree_entry_view r;
    r.perm = e.perm;
    r.type = t->type;
    r.mech = entry_mech(t, v, e);
    r.id = has_id(t->type) ? v.arena + e.id_off : nullptr;
    r.idlen = has_id(t->type) ? e.id_len : 0;
    return r;
}


int32_t twin(tree *t, const ent &e);

// Call f(index) for each present entry in order; f returns false to stop.
template <class F>
int32_t for_each_in_order(tree *t, const char *fname, F &&f) {
    if (!t) return 0;
    tview v = view_of(t);
    uint32_t sorted_upto = t->big ? t->big->sorted_upto : v.n;
    if (!sorted_type(t->type) || sorted_upto >= v.n) {
        for (uint32_t i = 0; i < v.n; ++i)
            if ((v.ents[i].flags & kPresent) && !f(i)) break;
        return 0;
    }
    if (t->big->descending) {
        for (uint32_t i = v.n; i-- > 0;)
            if ((v.ents[i].flags & kPresent) && !f(i)) break;
        return 0;
    }
    // Sort the present entries of the unsorted tail, then merge them with
    // the ascending prefix: one entry added to a tree read back costs a
    // walk, not a sort.  A prefix shorter than the tail is sorted with it;
    // merging would only chase the tail's identifiers through memory.
    if (sorted_upto < v.n - sorted_upto) sorted_upto = 0;
    size_t tail = 0;
    for (uint32_t i = sorted_upto; i < v.n; ++i)
        if (v.ents[i].flags & kPresent) ++tail;
    acl__sort_key *keys = nullptr;
    if (tail) {
        if (tail > acl__sort_max_keys()) return no_memory(fname, SIZE_MAX);
        const size_t bytes = acl__sort_area_bytes(tail);
        keys = static_cast<acl__sort_key *>(acl__malloc(bytes));
        if (!keys) return no_memory(fname, bytes);
        acl__advise_large(keys, bytes);
        size_t m = 0;
        for (uint32_t i = sorted_upto; i < v.n; ++i)
            if (v.ents[i].flags & kPresent) keys[m++].i = i;
        static_assert(offsetof(ent, id_off) == 0 && offsetof(ent, id_len) == sizeof(uint32_t),
                      "an entry's identifier offset and length lead it");
        acl__sort_ids(keys, tail, {v.arena, v.ents, sizeof(ent)});
    }
    // The tail's entries and identifiers are reached in sorted order, which
    // is no order in memory: fetched ahead, the misses overlap instead of
    // each costing a full trip to memory.  An identifier's entry is fetched
    // first, its text (both ends: one in two crosses a cache line) once
    // the entry has arrived.
    constexpr size_t kAhead = 32;
    // Where duplicates were deferred, a twin is met right beside: in the
    // merge, or next in the sorted tail, whose keys differ unless their
    // texts may be equal (the sort leaves equal texts with equal keys).
    const bool verify = t->big->defer_dups;
    const ent *twin_of = nullptr;
    uint32_t i = 0;
    size_t j = 0;
    for (;;) {
        if (j + 2 * kAhead < tail) __builtin_prefetch(&v.ents[keys[j + 2 * kAhead].i]);
        if (j + kAhead < tail) {
            const ent &ahead = v.ents[keys[j + kAhead].i];
            __builtin_prefetch(v.arena + ahead.id_off);
            __builtin_prefetch(v.arena + ahead.id_off + ahead.id_len);
        }
        while (i < sorted_upto && !(v.ents[i].flags & kPresent)) ++i;
        bool have_p = i < sorted_upto, have_t = j < tail;
        if (!have_p && !have_t) break;
        bool take_p = have_p;
        if (have_p && have_t) {
            const ent &ep = v.ents[i], &et = v.ents[keys[j].i];
            const int c = zo::casecmp_len(v.arena + ep.id_off, ep.id_len, v.arena + et.id_off, et.id_len);
            if (c == 0 && verify) {
                twin_of = &et;  // the tail comes after the whole prefix
                break;
            }
            take_p = c <= 0;
        }
        if (!take_p && verify && j > 0 && keys[j].k == keys[j - 1].k && keys[j].k2 == keys[j - 1].k2) {
            const ent &x = v.ents[keys[j - 1].i], &y = v.ents[keys[j].i];
            if (zo::casecmp_len(v.arena + x.id_off, x.id_len, v.arena + y.id_off, y.id_len) == 0) {
                twin_of = &y;  // equal texts sort in entry order
                break;
            }
        }
        if (!f(take_p ? i++ : keys[j++].i)) break;
    }
    std::free(keys);
    return twin_of ? twin(t, *twin_of) : 0;
}

// ---- Growing --------------------------------------------------------------------

// The slot holding the identifier, or the free slot where it goes.
size_t find_slot(const big_part *b, uint32_t h, const char *id, size_t idlen, bool *found) {
    size_t s = slot_of(h, b->idx_mask);
    for (; b->idx[s]; s = (s + 1) & b->idx_mask) {
        if (slot_hash(b->idx[s]) != h) continue;
        const ent &e = b->ents[slot_entry(b->idx[s])];
        if (e.id_len == idlen && fold_eq(b->arena + e.id_off, id, idlen)) {
            *found = true;
            return s;
        }
    }
    *found = false;
    return s;
}

// Keep the index at most half full for `need` identifiers.
bool grow_index(big_part *b, size_t need, size_t *failed) {
    size_t slots = size_t{b->idx_mask} + 1;
    if (b->idx && need <= slots / 2) return true;
    size_t ns = b->idx ? slots : 8;
    // Quadrupling: every rebuild rehashes every identifier into pages that
    // have never been touched, so fewer rebuilds cost less than the unused
    // slots do.
    while (ns / 2 < need) ns *= 4;
    if (ns > (size_t{1} << 31)) {
        *failed = SIZE_MAX;
        return false;
    }
    auto *ni = static_cast<uint64_t *>(acl__calloc(ns, sizeof(uint64_t)));
    if (!ni) {
        *failed = ns * sizeof(uint64_t);
        return false;
    }
    acl__advise_large(ni, ns * sizeof(uint64_t));
    uint64_t *old = b->idx;
    const size_t old_slots = old ? slots : 0;
    b->idx = ni;
    b->idx_mask = static_cast<uint32_t>(ns - 1);
    if (old) {
        for (size_t s = 0; s < old_slots; ++s) {
            if (!old[s]) continue;
            size_t t = slot_of(slot_hash(old[s]), b->idx_mask);
            while (ni[t]) t = (t + 1) & b->idx_mask;
            ni[t] = old[s];
        }
        std::free(old);
        return true;
    }
    // First build: each identifier's slot goes to its latest entry, so walk
    // backwards and skip an entry whose identifier is already placed (a
    // removed one that was inserted again later).
    b->idx_used = 0;
    for (uint32_t i = b->n; i-- > 0;) {
        const ent &e = b->ents[i];
        const uint32_t h = e.flags & kHashMask;
        bool found = false;
        size_t s = find_slot(b, h, b->arena + e.id_off, e.id_len, &found);
        if (found) continue;
        ni[s] = slot_value(h, i);
        ++b->idx_used;
    }
    return true;
}

// The arrays of the growable form; the big_part itself lives in the tree's
// block.
void free_big(big_part *b) {
    if (!b) return;
    if (!b->ents_pooled) std::free(b->ents);
    if (!b->borrowed) std::free(b->arena);
    std::free(b->idx);
}

// The first eight folded bytes of an identifier as a number that orders as
// the text does, or 0 when they cannot decide alone (an empty identifier, or
// a NUL among them, where the comparison of texts stops).  Comparing with
// the latest entry is then mostly done without reading its identifier,
// which a parsed text keeps far from anything else in cache.
uint64_t order_key(const char *id, size_t len) {
    if (len >= 8 && std::endian::native == std::endian::little) {
        const uint64_t v = zo::load8(id);
        if ((v - 0x0101010101010101ull) & ~v & 0x8080808080808080ull) return 0;  // a zero byte
        return __builtin_bswap64(zo::fold8(v));
    }
    unsigned char b[8] = {};
    std::memcpy(b, id, len < 8 ? len : 8);
    uint64_t k = 0;
    for (size_t j = 0; j < 8; ++j) {
        if (j < len && b[j] == 0) return 0;
        k = (k << 8) | zo::fold(b[j]);
    }
    return k;
}

// A block for a tree: from the pool when there is one and the block is
// small, else from the heap.
void *tree_block(acl__pool *pool, size_t n, bool *pooled, size_t align = 16) {
    *pooled = pool && n <= acl__pool_max_block;
    return *pooled ? acl__pool_alloc(pool, n, align) : acl__malloc(n);
}

// Grow the entry array to hold `need`, doubling.  A pooled array moves to a
// new block (the pool releases the old one with the rest), to the heap once
// it is too large to pool or no pool is given.
bool grow_ents(big_part *b, size_t need, acl__pool *pool, size_t *failed) {
    if (need <= b->cap) return true;
    if (!b->ents_pooled) return acl__grow(&b->ents, &b->cap, need, failed);
    size_t nc = b->cap ? b->cap : 4;
    while (nc < need) nc *= 2;
    ent *ne = nullptr;
    uint32_t cap = 0;
    bool pooled = false;
    if (nc * sizeof(ent) <= acl__pool_max_block && pool) {
        ne = static_cast<ent *>(tree_block(pool, nc * sizeof(ent), &pooled));
        cap = static_cast<uint32_t>(nc);
        if (!ne) *failed = nc * sizeof(ent);
    } else if (!acl__grow(&ne, &cap, need, failed)) {
        ne = nullptr;
    }
    if (!ne) return false;
    if (b->n) std::memcpy(static_cast<void *>(ne), b->ents, size_t{b->n} * sizeof(ent));
    b->ents = ne;
    b->cap = cap;
    b->ents_pooled = pooled;
    return true;
}

// Move a one-entry tree to the growable form, with room for `more` further
// entries and `bytes` further arena bytes; one whose entry came from `text`
// borrows that text as its arena.  The block is reallocated, so the link to
// the tree is updated.
int32_t promote(tree **node, size_t more, size_t bytes, const char *text = nullptr, acl__pool *pool = nullptr,
                bool defer = false) {
    static_assert(sizeof(tree) % alignof(big_part) == 0, "big_part follows the header");
    const char *fname = "sec__add_acle_to_tree";
    tree *t = *node;
    const size_t inl = t->e0.id_off + size_t{t->e0.id_len} + 1;
    const size_t keep = t->mechlen + 1u;
    const uint64_t key0 = order_key(inline_bytes(t) + t->e0.id_off, t->e0.id_len);
    size_t failed = 0;
    big_part nb{};
    // A tree that grows past one entry usually grows further: start with
    // room for several, so a small tree is not reallocated at every step.
    nb.ents_pooled = pool != nullptr;
    bool ok = grow_ents(&nb, more >= UINT32_MAX ? UINT32_MAX : (more < 7 ? 8 : 1 + more), pool, &failed);
    size_t want = inl + bytes < 256 ? 256 : inl + bytes;
    nb.borrowed = text && t->e0_in_text;
    if (ok && !nb.borrowed) ok = acl__grow(&nb.arena, &nb.arena_cap,
                                          want > UINT32_MAX ? UINT32_MAX : want, &failed);
    tree *nt = nullptr;
    if (ok) {
        if (nb.borrowed) nb.arena = const_cast<char *>(text);  // never written through
        else std::memcpy(nb.arena, inline_bytes(t), inl);
        bool pooled = false;
        // On a line of its own: what finding and growing the tree reads
        // is then two lines, fetched ahead.
        nt = static_cast<tree *>(tree_block(pool, sizeof(tree) + sizeof(big_part) + keep, &pooled, 64));
        if (!nt) failed = sizeof(tree) + sizeof(big_part) + keep;
        if (nt) {
            // The header, then mech0 behind the big_part.
            std::memcpy(static_cast<void *>(nt), t, sizeof(tree));
            std::memcpy(reinterpret_cast<char *>(nt) + sizeof(tree) + sizeof(big_part), inline_bytes(t), keep);
            nt->pooled = pooled;
            if (!t->pooled) std::free(t);
        }
    }
    if (!nt) {
        free_big(&nb);
        return no_memory(fname, failed);
    }
    char *base = reinterpret_cast<char *>(nt) + sizeof(tree);
    nb.arena_len = nb.borrowed ? 0 : static_cast<uint32_t>(inl);
    nb.ents[0] = nt->e0;
    if (nb.borrowed) nb.ents[0].id_off = nt->e0_text_off;
    nb.n = 1;
    nb.n_present = (nt->e0.flags & kPresent) ? 1 : 0;
    nb.id_bytes = nb.n_present ? nt->e0.id_len : 0;
    nb.n_long = nb.n_present && too_long(nt->e0.id_len);
    nb.sorted_upto = 1;
    nb.descending = true;
    nb.last_key = key0;
    nb.defer_dups = defer && sorted_type(nt->type);
    nt->big = reinterpret_cast<big_part *>(base);
    std::memcpy(static_cast<void *>(nt->big), &nb, sizeof nb);
    *node = nt;
    return 0;
}

// The sign of the latest entry's identifier against id, whose order_key is k.
int against_latest(const big_part *b, uint64_t k, const char *id, size_t idlen) {
    if (k && b->last_key && k != b->last_key) return b->last_key < k ? -1 : 1;
    const ent &e = b->ents[b->n - 1];
    return zo::casecmp_len(b->arena + e.id_off, e.id_len, id, idlen);
}

// Give a tree that borrows its identifiers an arena of its own, for an
// entry that does not come from the borrowed text.
int32_t unborrow(big_part *b) {
    size_t bytes = 0;
    for (uint32_t i = 0; i < b->n; ++i) bytes += size_t{b->ents[i].id_len} + 1;
    if (bytes > UINT32_MAX) return no_memory("sec__add_acle_to_tree", SIZE_MAX);
    uint32_t cap = 0;
    char *arena = nullptr;
    size_t failed = 0;
    if (!acl__grow(&arena, &cap, bytes, &failed)) return no_memory("sec__add_acle_to_tree", failed);
    uint32_t at = 0;
    for (uint32_t i = 0; i < b->n; ++i) {
        ent &e = b->ents[i];
        std::memcpy(arena + at, b->arena + e.id_off, size_t{e.id_len} + 1);
        e.id_off = at;
        at += e.id_len + 1;
    }
    b->arena = arena;
    b->arena_len = at;
    b->arena_cap = cap;
    b->borrowed = false;
    return 0;
}

// ---- Inserting ------------------------------------------------------------------

const char *type_name(unsigned t) {
    switch (t) {
    case SEC_ACLE_TYPE_UNAUTHENTICATED: return "unauthenticated";
    case SEC_ACLE_TYPE_ANYOTHER: return "anyother";
    case SEC_ACLE_TYPE_USER: return "user";
    case SEC_ACLE_TYPE_EXPANDED: return "user-expanded";
    default: return "group";
    }
}

// An entry to insert, its identifier's hash taken only when an index is
// consulted.
struct new_entry : acl__entry_parts {
    explicit new_entry(const acl__entry_parts &p) : acl__entry_parts(p) {}
    uint32_t h() const {
        if (!hashed) idhash = acl__id_hash(id, idlen), hashed = true;
        return idhash;
    }
};

// The refusal of an entry whose identity is already there.
int32_t refuse_duplicate(const acl__entry_parts &ne) {
    const char letter = acl__type_letter(ne.type);
    switch (ne.type) {
    case SEC_ACLE_TYPE_UNAUTHENTICATED:
    case SEC_ACLE_TYPE_ANYOTHER: return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::DUPLICATE_SINGLE_ACLE, letter);
    case SEC_ACLE_TYPE_GROUP: return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::DUPLICATE_GROUP, letter, ne.id);
    default: return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::DUPLICATE_ACLE, letter, ne.mech, ne.id);
    }
}

int32_t duplicate(sec_boolean_t single, const new_entry &ne, ent &stored) {
    if (single) return refuse_duplicate(ne);
    stored.perm = ne.perm;
    using namespace acl::trace;
    const char *mech = (has_mech(ne.type) || ne.type == SEC_ACLE_TYPE_GROUP) ? ne.mech : "<none>";
    const char *id = ne.type == SEC_ACLE_TYPE_USER ? ne.id : "<none>";
    point(INFO, 113, {str(type_name(ne.type)), str(mech), str(id)});
    return 0;
}

// The duplicate record of e, the later of two equal identifiers found by
// an ordered visit.
int32_t twin(tree *t, const ent &e) {
    const tview v = view_of(t);
    acl__entry_parts parts;
    parts.type = t->type;
    parts.mech = entry_mech(t, v, e);
    parts.id = v.arena + e.id_off;
    return refuse_duplicate(parts);
}

// Create a one-entry tree.
int32_t create(const new_entry &ne, tree **node, acl__pool *pool) {
    const size_t mechlen = has_mech(ne.type) ? ne.mechlen : 0;
    size_t size = sizeof(tree) + mechlen + 1;
    if (ne.idlen > UINT32_MAX - mechlen - 2 || size + ne.idlen + 1 < size)
        return no_memory("sec__add_acle_to_tree", SIZE_MAX);
    size += ne.idlen + 1;
    bool pooled = false;
    auto *t = static_cast<tree *>(tree_block(pool, size, &pooled));
    if (!t) return no_memory("sec__add_acle_to_tree", size);
    t->pooled = pooled;
    t->big = nullptr;
    t->type = ne.type;
    t->mechlen = static_cast<unsigned char>(mechlen);
    t->e0_in_text = ne.text && has_id(ne.type);
    t->e0_text_off = t->e0_in_text ? static_cast<uint32_t>(ne.id - ne.text) : 0;
    char *p = inline_bytes(t);
    std::memcpy(p, ne.mech, mechlen);
    p[mechlen] = '\0';
    std::memcpy(p + mechlen + 1, ne.id, ne.idlen);
    p[mechlen + 1 + ne.idlen] = '\0';
    t->e0 = ent{static_cast<uint32_t>(mechlen + 1), static_cast<uint32_t>(ne.idlen), ne.perm,
                (has_id(ne.type) ? ne.h() : 0) | kPresent};
    *node = t;
    return 0;
}

size_t probe(const big_part *b, const new_entry &ne, bool *found) {
    return find_slot(b, ne.h(), ne.id, ne.idlen, found);
}

bool ordered(const big_part *b) { return b->sorted_upto == b->n || b->descending; }

// The present entry of the identifier in a small unordered tree, or null.
ent *scan(big_part *b, const new_entry &ne) {
    const uint32_t h = ne.h();
    for (uint32_t j = 0; j < b->n; ++j) {
        ent &e = b->ents[j];
        if ((e.flags & (kHashMask | kPresent)) == (h | kPresent) && e.id_len == ne.idlen &&
            fold_eq(b->arena + e.id_off, ne.id, ne.idlen))
            return &e;
    }
    return nullptr;
}

// Where the identifiers arrive in one direction, binary search finds an
// entry without an index.  Returns its position or n.
uint32_t find_ordered(const big_part *b, const char *id, size_t idlen) {
    uint32_t lo = 0, hi = b->n;
    while (lo < hi) {
        uint32_t mid = lo + (hi - lo) / 2;
        const ent &e = b->ents[mid];
        int c = zo::casecmp_len(b->arena + e.id_off, e.id_len, id, idlen);
        if (c == 0) return mid;
        if ((c < 0) != b->descending) lo = mid + 1;
        else hi = mid;
    }
    return b->n;
}

bool small_matches(const tree *t, const new_entry &ne) {
    return t->e0.id_len == ne.idlen && fold_eq(inline_bytes(t) + t->e0.id_off, ne.id, ne.idlen);
}

// Whether the mechanism is spelt as the tree's first entry spells it (the
// two are known to be equal but for case).  A few bytes: no call.
bool same_spelling(const tree *t, const char *mech) {
    const char *m0 = inline_bytes(t);
    for (unsigned k = 0; k < t->mechlen; ++k)
        if (m0[k] != mech[k]) return false;
    return true;
}

// `held`: the caller has checked that the tree is the entry's sub-ACL's.
// `pool`: the trees' pool, for the tree's small blocks (null: the heap).
int32_t insert(sec_boolean_t single, const new_entry &ne, tree **node, bool held = false, acl__pool *pool = nullptr,
               bool defer = false) {
    const char *fname = "sec__add_acle_to_tree";
    tree *t = *node;
    if (!t) return create(ne, node, pool);
    if (!held && !acl__tree_holds(t, ne.type, ne.mech, ne.mechlen))
        return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, fname, 2, ne.type);

    if (!t->big) {
        if ((t->e0.flags & kPresent) && (!has_id(t->type) || small_matches(t, ne)))
            return duplicate(single, ne, t->e0);
        if (int32_t rc = promote(node, 1, ne.idlen + 1 + ne.mechlen + 1, ne.text, pool, defer)) return rc;
        t = *node;
    }
    big_part *b = t->big;
    const uint32_t i = b->n;
    size_t failed = 0;
    bool found = false;
    size_t slot = 0;
    int last_cmp = 0;  // previous identifier against the new one
    uint64_t key = 0;  // the new identifier's order_key, while a run may go on
    if (!has_id(t->type)) {
        uint32_t f = first_present(t);
        if (f < b->n) return duplicate(single, ne, b->ents[f]);
    } else {
        // Once neither direction holds the comparison tells nothing more.
        const bool compared = b->sorted_upto == i || b->descending;
        if (compared) {
            key = order_key(ne.id, ne.idlen);
            last_cmp = against_latest(b, key, ne.id, ne.idlen);
        }
        const bool in_run = (last_cmp < 0 && b->sorted_upto == i) || (last_cmp > 0 && b->descending);
        if (b->defer_dups) {
            // In a run only the latest entry can be a twin; out of one, the
            // ordered visit looks.
            if (compared && last_cmp == 0) return duplicate(single, ne, b->ents[i - 1]);
        } else if (!b->idx && !in_run) {
            if (i > kScanMax) {
                if (!grow_index(b, size_t{i} + 1, &failed)) return no_memory(fname, failed);
            } else if (ent *d = scan(b, ne)) {
                return duplicate(single, ne, *d);
            }
        }
        if (b->idx) {
            slot = probe(b, ne, &found);
            if (found && (b->ents[slot_entry(b->idx[slot])].flags & kPresent))
                return duplicate(single, ne, b->ents[slot_entry(b->idx[slot])]);
        }
    }

    // A new entry: make room everywhere before changing anything.
    const bool own = has_mech(t->type) && !same_spelling(t, ne.mech);
    const bool borrow = b->borrowed && ne.text == b->arena && has_id(t->type) && !own;
    if (b->borrowed && !borrow)
        if (int32_t rc = unborrow(b)) return rc;
    const size_t add = borrow ? 0 : (own ? t->mechlen + 1 : 0) + ne.idlen + 1;
    if (i == UINT32_MAX || add > UINT32_MAX - size_t{b->arena_len}) return no_memory(fname, SIZE_MAX);
    if (!grow_ents(b, size_t{i} + 1, pool, &failed) ||
        (!borrow && !acl__grow(&b->arena, &b->arena_cap, size_t{b->arena_len} + add, &failed)))
        return no_memory(fname, failed);
    if (b->idx && !found) {
        uint64_t *old = b->idx;
        if (!grow_index(b, size_t{b->idx_used} + 1, &failed)) return no_memory(fname, failed);
        if (b->idx != old) slot = probe(b, ne, &found);
    }

    const char *p = ne.id;  // where the stored identifier is
    if (!borrow) {
        char *q = b->arena + b->arena_len;
        if (own) {
            std::memcpy(q, ne.mech, t->mechlen);
            q[t->mechlen] = '\0';
            q += t->mechlen + 1;
        }
        std::memcpy(q, ne.id, ne.idlen);
        q[ne.idlen] = '\0';
        p = q;
    }
    b->ents[i] = ent{static_cast<uint32_t>(p - b->arena), static_cast<uint32_t>(ne.idlen), ne.perm,
                     (b->defer_dups ? 0u : ne.h()) | kPresent | (own ? kOwnMech : 0)};
    b->arena_len += static_cast<uint32_t>(add);
    if (b->idx) {
        if (!found) ++b->idx_used;
        b->idx[slot] = slot_value(ne.h(), i);  // a removed entry of the same identifier gives up its slot
    }
    if (has_id(t->type)) {
        if (b->sorted_upto == i && last_cmp < 0) b->sorted_upto = i + 1;
        b->descending = b->descending && last_cmp > 0;
        if (b->sorted_upto == i + 1 || b->descending) b->last_key = key;  // taken above: a run went on
    }
    b->n = i + 1;
    ++b->n_present;
    b->id_bytes += static_cast<uint32_t>(ne.idlen);
    b->n_long += too_long(static_cast<uint32_t>(ne.idlen));
    return 0;
}


}  // namespace

// ---- Public operations ------------------------------------------------------------

int32_t sec__add_acle_to_tree(sec_boolean_t single, const sec_acle_desc *acle, sec_acltree_t *node) {
    if (!acle) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__add_acle_to_tree", 2, 0);
    if (!node) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__add_acle_to_tree", 3, 0);
    acl__entry_parts parts;
    if (!acl__entry_parts_of(acle, &parts)) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::BAD_ACLE_TYPE, acle->type);
    return insert(single, new_entry(parts), node);
}

bool acl__entry_parts_of(const sec_acle_desc *acle, acl__entry_parts *parts) {
    // The record's mechanism is a 17-byte field; one without its NUL is
    // taken as its first 16 characters rather than read past.
    const size_t mechlen = has_mech(acle->type) ? strnlen(acle->mech, kMechMax) : 0;
    const size_t idlen = has_id(acle->type) && acle->id ? std::strlen(acle->id) : 0;
    acl__entry_parts_known(*acle, mechlen, idlen, parts);
    return acl__valid_type(acle->type);
}

// A record of a type with an identifier but none given is taken as an
// empty identifier; the types without one drop any they carry.
void acl__entry_parts_known(const sec_acle_desc &acle, size_t mechlen, size_t idlen, acl__entry_parts *parts) {
    *parts = acl__entry_parts{};
    parts->type = acle.type;
    parts->perm = acle.perm;
    parts->mech = has_mech(acle.type) ? acle.mech : "";
    parts->mechlen = has_mech(acle.type) ? mechlen : 0;
    parts->id = has_id(acle.type) && acle.id ? acle.id : "";
    parts->idlen = has_id(acle.type) && acle.id ? idlen : 0;
}

int32_t acl__tree_insert_held(sec_acltree_t *node, sec_boolean_t single, const acl__entry_parts &parts,
                              acl__pool *pool, bool defer) {
    return insert(single, new_entry(parts), node, true, pool, defer);
}

bool acl__tree_holds(const sec_acltree_s *t, unsigned char type, const char *mech, size_t mechlen) {
    if (!t || t->type != type) return false;
    if (!has_mech(type)) return true;
    return t->mechlen == mechlen && fold_eq(inline_bytes(t), mech, mechlen);
}

const size_t acl__tree_head_bytes = sizeof(tree) + sizeof(big_part) + kMechMax + 1;

uint32_t acl__id_hash(const char *id, size_t idlen) { return fold_hash(id, idlen) & kHashMask; }

void acl__tree_prefetch(const sec_acltree_s *t, uint32_t idhash) {
    if (!t || !t->big) return;  // a one-entry tree is its own block
    const big_part *b = t->big;
    if (b->idx) {
        // The probe runs on from the home slot, often into the next line.
        const size_t home = slot_of(idhash, b->idx_mask);
        __builtin_prefetch(&b->idx[home]);
        __builtin_prefetch(&b->idx[(home + 8) & b->idx_mask]);
    } else if (b->n <= kScanMax) {
        // A small tree scans its entries.
        const char *e = reinterpret_cast<const char *>(b->ents);
        for (size_t off = 0; off < size_t{b->n} * sizeof(ent); off += 64) __builtin_prefetch(e + off);
    } else if (b->n > 0) {
        // An ordered one compares with its last entry only.
        __builtin_prefetch(&b->ents[b->n - 1]);
    }
    __builtin_prefetch(b->ents + b->n, 1);
    if (!b->borrowed) __builtin_prefetch(b->arena + b->arena_len, 1);
}

uint32_t acl__tree_key_hash(const sec_acltree_s *t) {
    return acl__subacl_key_hash(t->type, inline_bytes(t), t->mechlen);
}

int32_t acl__tree_insert(sec_acltree_t *node, sec_boolean_t single, unsigned char type, uint32_t perm,
                         const char *mech, size_t mechlen, const char *id, size_t idlen) {
    acl__entry_parts parts;
    parts.type = type;
    parts.perm = perm;
    parts.mech = has_mech(type) ? mech : "";
    parts.mechlen = has_mech(type) ? mechlen : 0;
    parts.id = has_id(type) ? id : "";
    parts.idlen = has_id(type) ? idlen : 0;
    return insert(single, new_entry(parts), node);
}

int32_t acl__tree_reserve(sec_acltree_t *node, size_t entries, size_t bytes) {
    sec_acltree_t t = node ? *node : nullptr;
    if (!t) return 0;
    if (!t->big) return promote(node, entries, bytes);
    big_part *b = t->big;
    if (b->borrowed)
        if (int32_t rc = unborrow(b)) return rc;
    size_t failed = 0;
    size_t ne = size_t{b->n} + entries, nb = size_t{b->arena_len} + bytes;
    if (ne > UINT32_MAX) ne = UINT32_MAX;
    if (nb > UINT32_MAX) nb = UINT32_MAX;
    if (!grow_ents(b, ne, nullptr, &failed) ||
        !acl__grow(&b->arena, &b->arena_cap, nb, &failed) ||
        (b->idx && !grow_index(b, size_t{b->idx_used} + entries, &failed)))
        return no_memory("sec__add_acle_to_tree", failed);
    return 0;
}

int32_t sec__del_acle_from_tree(const sec_acle_desc *acle, sec_acltree_t t) {
    if (!acle) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__del_acle_from_tree", 1, 0);
    acl__entry_parts parts;
    acl__entry_parts_of(acle, &parts);
    const new_entry ne(parts);
    auto not_found = [&] {
        return acl::set_error(ACL_RC_NO_MATCH, acl::msg::ACLE_NOT_IN_ACL, acle->type, has_mech(acle->type) ? ne.mech : "",
                              has_id(acle->type) ? ne.id : "");
    };
    // The given entry must be of the tree's type; its mechanism is not
    // compared, since a tree holds one mechanism.
    if (!t || t->type != acle->type) return not_found();
    if (!has_id(t->type)) {
        // Unauthenticated and anyother: whatever the given entry carries.
        uint32_t f = first_present(t);
        tview v = view_of(t);
        if (f >= v.n) return not_found();
        mark_removed(t, v.ents[f]);
        return 0;
    }
    if (!t->big) {
        if ((t->e0.flags & kPresent) && small_matches(t, ne)) {
            mark_removed(t, t->e0);
            return 0;
        }
        return not_found();
    }
    big_part *b = t->big;
    uint32_t at = b->n;
    if (b->idx) {
        bool found = false;
        size_t s = probe(b, ne, &found);
        if (found) at = slot_entry(b->idx[s]);
    } else if (ordered(b)) {
        at = find_ordered(b, ne.id, ne.idlen);
    } else if (ent *e = scan(b, ne)) {
        at = static_cast<uint32_t>(e - b->ents);
    }
    if (at >= b->n || !(b->ents[at].flags & kPresent)) return not_found();
    mark_removed(t, b->ents[at]);
    return 0;
}

void sec__free_acltree(sec_acltree_t t) {
    if (!t) return;
    free_big(t->big);
    if (!t->pooled) std::free(t);
}

int32_t sec__acltree_to_aclelist(sec_acltree_t t, sec_acle_list_t list) {
    const char *fname = "sec__acltree_to_aclelist";
    if (!list) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, fname, 2, 0);
    const uint32_t n = t ? present_count(t) : 0;
    if (n == 0) return 0;
    // Room for every entry at once: one reallocation per tree, not one per
    // entry.
    size_t count = list->count > 0 ? static_cast<size_t>(list->count) : 0;
    if (count + n > INT32_MAX) return no_memory(fname, SIZE_MAX);
    size_t bytes = (count + n) * sizeof(sec_acle_t);
    void *na = acl__realloc(list->acles, bytes);
    if (!na) return no_memory(fname, bytes);
    list->acles = static_cast<sec_acle_t *>(na);
    list->count = static_cast<int32_t>(count);

    int32_t rc = 0;
    tview v = view_of(t);
    int32_t vrc = for_each_in_order(t, fname, [&](uint32_t i) {
        ent &e = v.ents[i];
        auto *r = static_cast<sec_acle_t>(acl__calloc(1, sizeof(sec_acle_desc)));
        if (!r) {
            rc = no_memory(fname, sizeof(sec_acle_desc));
            return false;
        }
        r->perm = e.perm;
        r->type = t->type;
        if (has_mech(t->type)) std::memcpy(r->mech, entry_mech(t, v, e), t->mechlen + 1u);
        if (has_id(t->type)) {
            r->id = acl__strdup(v.arena + e.id_off);
            if (!r->id) {
                std::free(r);
                rc = no_memory(fname, size_t{e.id_len} + 1);
                return false;
            }
        }
        list->acles[list->count++] = r;
        mark_removed(t, e);
        return true;
    });
    return vrc ? vrc : rc;
}

unsigned char acl__tree_type(const sec_acltree_s *t) { return t ? t->type : 0; }

size_t acl__tree_count(const sec_acltree_s *t) { return t ? present_count(t) : 0; }

const char *acl__tree_mech(const sec_acltree_s *ct) {
    if (!ct) return "";
    auto *t = const_cast<tree *>(ct);  // first_live only caches a search
    uint32_t f = first_present(t);
    tview v = view_of(t);
    if (f >= v.n) return "";
    return entry_mech(t, v, v.ents[f]);
}

size_t acl__tree_mechlen(const sec_acltree_s *t) { return t ? t->mechlen : 0; }

int32_t acl__tree_visit_named(sec_acltree_s *t, acl__tree_visit_fn fn, void *ctx, const char *fname) {
    if (!t || !fn) return 0;
    tview v = view_of(t);
    return for_each_in_order(t, fname, [&](uint32_t i) {
        acl__tree_entry_view e = make_view(t, v, v.ents[i]);
        return fn(&e, ctx);
    });
}

void acl__tree_visit_prefetch(const sec_acltree_s *t, int stage) {
    // Enough for the small trees of an ACL with thousands of mechanisms,
    // whose blocks are scattered over the heap and whose identifiers over
    // the file they were parsed from; a large tree's own walk fetches ahead.
    constexpr uint32_t kEntries = 16;
    if (!t) return;
    if (stage == 0) {
        __builtin_prefetch(t);
        __builtin_prefetch(reinterpret_cast<const char *>(t) + 64);
        return;
    }
    const big_part *b = t->big;
    if (!b) return;  // one block, fetched by stage 0
    const uint32_t n = b->n < kEntries ? b->n : kEntries;
    if (stage == 1) {
        const char *e = reinterpret_cast<const char *>(b->ents);
        for (size_t off = 0; off < size_t{n} * sizeof(ent); off += 64) __builtin_prefetch(e + off);
        return;
    }
    for (uint32_t i = 0; i < n; ++i) {
        const ent &e = b->ents[i];
        __builtin_prefetch(b->arena + e.id_off);
        __builtin_prefetch(b->arena + e.id_off + e.id_len);
    }
}

int32_t acl__tree_visit(sec_acltree_s *t, acl__tree_visit_fn fn, void *ctx) {
    return acl__tree_visit_named(t, fn, ctx, "acl__tree_visit");
}

void acl__tree_stats(const sec_acltree_s *t, size_t *count, uint64_t *id_bytes, bool *too_long_id) {
    *count = 0;
    *id_bytes = 0;
    *too_long_id = false;
    if (!t) return;
    if (const big_part *b = t->big) {
        *count = b->n_present;
        *id_bytes = b->id_bytes;
        *too_long_id = b->n_long != 0;
    } else if (t->e0.flags & kPresent) {
        *count = 1;
        *id_bytes = t->e0.id_len;
        *too_long_id = too_long(t->e0.id_len);
    }
}
