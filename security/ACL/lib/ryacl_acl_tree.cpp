// ACL trees.  A tree keeps the entries of one sub-ACL in insertion order in
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
// identifier for user and group entries.  An ascending tree is walked
// forwards, a descending one backwards; otherwise only the part after the
// ascending prefix is sorted and merged in, so one entry added to a tree
// read back costs a walk, not a sort.
//
// A tree that has only ever held one entry keeps it inline in a single
// heap block: an ACL whose every entry has its own mechanism is a million
// one-entry trees, and several blocks each would blow the memory budget.
#include "ryacl_acl_tree.h"

#include <sys/mman.h>

#include <cstdlib>
#include <cstring>
#include <utility>

#include "ry_zo_int.h"
#include "ryacl_acl_entry.h"
#include "ryacl_alloc.h"
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
        bool descending;       // every entry so far descends strictly
    };

    // Null while the tree holds only the entry it was created with; then
    // it points just behind this header, in the same block, so an
    // insertion reaches the tree's counters without another miss.
    big_part *big;
    ent e0;  // that entry, while big is null
    unsigned char type;
    unsigned char mechlen;  // length of mech0
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

using zo::fold;
using zo::fold8;
using zo::load8;

bool fold_eq(const char *a, const char *b, size_t n) {
    size_t i = 0;
    for (; i + 8 <= n; i += 8)
        if (fold8(load8(a + i)) != fold8(load8(b + i))) return false;
    for (; i < n; ++i)
        if (fold(static_cast<unsigned char>(a[i])) != fold(static_cast<unsigned char>(b[i]))) return false;
    return true;
}

uint32_t fold_hash(const char *s, size_t n, uint64_t seed = 0) {
    uint64_t h = 0x9e3779b97f4a7c15ull ^ seed ^ n;
    size_t i = 0;
    for (; i + 8 <= n; i += 8) {
        h ^= fold8(load8(s + i));
        h *= 0xff51afd7ed558ccdull;
        h ^= h >> 29;
    }
    uint64_t tail = 0;
    for (unsigned sh = 0; i < n; ++i, sh += 8) tail |= uint64_t{fold(static_cast<unsigned char>(s[i]))} << sh;
    h ^= tail;
    h *= 0xc4ceb9fe1a85ec53ull;
    h ^= h >> 32;
    h *= 0xff51afd7ed558ccdull;
    h ^= h >> 29;
    return static_cast<uint32_t>(h >> 32);
}

inline size_t slot_of(uint32_t h, uint32_t mask) { return (h >> 2) & mask; }
inline uint64_t slot_value(uint32_t h, uint32_t i) { return (uint64_t{h} << 32) | (uint64_t{i} + 1); }
inline uint32_t slot_hash(uint64_t v) { return static_cast<uint32_t>(v >> 32); }
inline uint32_t slot_entry(uint64_t v) { return static_cast<uint32_t>(v) - 1; }

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

void mark_removed(tree *t, ent &e) {
    if (!(e.flags & kPresent)) return;
    e.flags &= ~kPresent;
    if (t->big) --t->big->n_present;
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

// ---- Ordering ------------------------------------------------------------------
// Multikey quicksort on eight folded bytes at a time: the keys of a range
// are compared as integers, and only a range whose keys tie moves on to the
// next eight bytes.  Identifiers of a real ACL share long prefixes
// ("user0001..."), which would make a plain comparison sort chase every
// string through memory.

struct skey {
    uint64_t k;     // folded bytes [depth, depth + 8), big-endian, zero past the end
    uint64_t next;  // the eight after, while the range's `nv` says so
    uint32_t i;     // entry index
};

uint64_t chunk(const char *s, size_t len, size_t depth) {
    if (depth >= len) return 0;
    unsigned char b[8] = {};
    size_t m = len - depth < 8 ? len - depth : 8;
    std::memcpy(b, s + depth, m);
    uint64_t v;
    std::memcpy(&v, b, 8);
    v = fold8(v);
    std::memcpy(b, &v, 8);
    uint64_t k = 0;
    for (unsigned j = 0; j < 8; ++j) k = (k << 8) | b[j];
    return k;
}

// A range of the key array whose entries share their first d bytes.
struct rtask {
    size_t lo, n;
    unsigned d;
};
// Ranges this small sort faster by comparison than by another pass.
constexpr size_t kRadixMin = 64;
// Sixteen levels of at most 255 ranges waiting each, and the one at work.
constexpr size_t kRadixStack = 16 * 255 + 1;

struct sorter {
    skey *a;
    const ent *ents;
    const char *arena;

    // Sixteen bytes per load: most identifiers part within them, so a tied
    // range usually moves on to its next eight bytes without going back to
    // the arena (where, once partitioned, every access would be a miss).
    void load(size_t lo, size_t n, size_t depth) {
        for (size_t j = lo; j < lo + n; ++j) {
            const ent &e = ents[a[j].i];
            a[j].k = chunk(arena + e.id_off, e.id_len, depth);
            a[j].next = chunk(arena + e.id_off, e.id_len, depth + 8);
        }
    }
    // Move a tied range on to depth (8 further); true when `next` is again
    // valid afterwards.
    bool advance(size_t lo, size_t n, size_t depth, bool nv) {
        if (!nv) {
            load(lo, n, depth);
            return true;
        }
        for (size_t j = lo; j < lo + n; ++j) a[j].k = a[j].next;
        return false;
    }
    // Full order of two entries whose first `depth` folded bytes are equal
    // and whose keys hold the next eight.
    bool less(const skey &x, const skey &y, size_t depth, bool nv) const {
        if (x.k != y.k) return x.k < y.k;
        if (nv && x.next != y.next) return x.next < y.next;
        const ent &ex = ents[x.i], &ey = ents[y.i];
        size_t from = depth + 8;
        const char *p = arena + ex.id_off, *q = arena + ey.id_off;
        size_t lp = ex.id_len, lq = ey.id_len;
        for (size_t j = from;; ++j) {
            int cp = j < lp ? fold(static_cast<unsigned char>(p[j])) : -1;
            int cq = j < lq ? fold(static_cast<unsigned char>(q[j])) : -1;
            if (cp != cq) return cp < cq;
            if (cp < 0) return x.i < y.i;  // equal texts: keep insertion order
        }
    }
    void insertion(size_t lo, size_t n, size_t depth, bool nv) {
        for (size_t j = lo + 1; j < lo + n; ++j) {
            skey v = a[j];
            size_t m = j;
            while (m > lo && less(v, a[m - 1], depth, nv)) {
                a[m] = a[m - 1];
                --m;
            }
            a[m] = v;
        }
    }
    // Fallback when partitioning stops making progress: O(n log n) always.
    void heapsort(size_t lo, size_t n, size_t depth, bool nv) {
        skey *h = a + lo;
        auto sift = [&](size_t root, size_t end) {
            for (;;) {
                size_t c = 2 * root + 1;
                if (c >= end) return;
                if (c + 1 < end && less(h[c], h[c + 1], depth, nv)) ++c;
                if (!less(h[root], h[c], depth, nv)) return;
                std::swap(h[root], h[c]);
                root = c;
            }
        };
        for (size_t r = n / 2; r-- > 0;) sift(r, n);
        for (size_t end = n; end-- > 1;) {
            std::swap(h[0], h[end]);
            sift(0, end);
        }
    }

    // Multikey quicksort of [lo, lo + n), whose keys hold bytes 0 to 15.
    void quicksort(size_t lo, size_t n) {
        struct task {
            size_t lo, n, depth;
            unsigned budget;
            bool nv;  // `next` holds the eight bytes after the key
        };
        // Continuing with the smallest piece and pushing the others keeps the
        // stack within two entries per halving of the range: 2 * 32 + slack.
        task stack[72];
        size_t sp = 0;
        unsigned budget0 = 2;
        for (size_t m = n; m > 1; m >>= 1) budget0 += 2;
        task cur{lo, n, 0, budget0, true};
        for (;;) {
            while (cur.n > 1) {
                if (cur.n <= 16) {
                    insertion(cur.lo, cur.n, cur.depth, cur.nv);
                    break;
                }
                if (cur.budget == 0) {
                    heapsort(cur.lo, cur.n, cur.depth, cur.nv);
                    break;
                }
                uint64_t x = a[cur.lo].k, y = a[cur.lo + cur.n / 2].k, z = a[cur.lo + cur.n - 1].k;
                uint64_t p = x < y ? (y < z ? y : (x < z ? z : x)) : (x < z ? x : (y < z ? z : y));
                size_t lt = cur.lo, j = cur.lo, gt = cur.lo + cur.n;
                while (j < gt) {
                    if (a[j].k < p) std::swap(a[lt++], a[j++]);
                    else if (a[j].k > p) std::swap(a[j], a[--gt]);
                    else ++j;
                }
                task pieces[3] = {{cur.lo, lt - cur.lo, cur.depth, cur.budget - 1, cur.nv},
                                  {lt, gt - lt, cur.depth + 8, budget0, false},
                                  {gt, cur.lo + cur.n - gt, cur.depth, cur.budget - 1, cur.nv}};
                // Keys that end inside this chunk are equal texts: done.  Else
                // the tied range goes on with its next eight bytes.
                if ((p & 0xff) == 0 || pieces[1].n < 2) {
                    if ((p & 0xff) == 0 && pieces[1].n > 1)
                        insertion(pieces[1].lo, pieces[1].n, cur.depth, cur.nv);
                    pieces[1].n = 0;
                } else {
                    pieces[1].nv = advance(pieces[1].lo, pieces[1].n, pieces[1].depth, cur.nv);
                }
                int small = -1;
                for (int q = 0; q < 3; ++q)
                    if (pieces[q].n > 1 && (small < 0 || pieces[q].n < pieces[small].n)) small = q;
                if (small < 0) break;
                for (int q = 0; q < 3; ++q)
                    if (q != small && pieces[q].n > 1) stack[sp++] = pieces[q];
                cur = pieces[small];
            }
            if (sp == 0) break;
            cur = stack[--sp];
        }
    }

    // Byte d (0 to 15) of the key that `k` and `next` hold from depth 0.
    static unsigned byte_at(const skey &x, unsigned d) {
        const uint64_t w = d < 8 ? x.k : x.next;
        return static_cast<unsigned>(w >> (56 - 8 * (d & 7))) & 0xff;
    }

    // Most significant byte first, in place (American flag sort): each pass
    // moves a range's entries once into its buckets, where quicksort would
    // move them once per halving.  Bytes every entry of a range shares are
    // stepped over without moving anything.  Small ranges, and ranges tied
    // through all sixteen bytes, go to quicksort, which begins at byte 0
    // again: the keys are unchanged, so the order it makes is the same.
    void sort(size_t n, rtask *stack) {
        load(0, n, 0);
        size_t sp = 0;
        stack[sp++] = {0, n, 0};
        size_t count[256], next[256];
        while (sp) {
            rtask t = stack[--sp];
            for (;;) {
                if (t.n <= kRadixMin || t.d >= 16) {
                    quicksort(t.lo, t.n);
                    break;
                }
                std::memset(count, 0, sizeof count);
                for (size_t j = t.lo; j < t.lo + t.n; ++j) ++count[byte_at(a[j], t.d)];
                if (count[byte_at(a[t.lo], t.d)] == t.n) {
                    ++t.d;
                    continue;
                }
                size_t start[256];
                for (size_t b = 0, at = t.lo; b < 256; ++b) {
                    start[b] = next[b] = at;
                    at += count[b];
                }
                for (unsigned b = 0; b < 256; ++b) {
                    const size_t end = start[b] + count[b];
                    while (next[b] < end) {
                        skey v = a[next[b]];
                        unsigned c = byte_at(v, t.d);
                        while (c != b) {
                            std::swap(v, a[next[c]++]);
                            c = byte_at(v, t.d);
                        }
                        a[next[b]++] = v;
                    }
                }
                // Bucket 0 holds identifiers that end here (none holds a
                // NUL): equal texts, which quicksort leaves in insertion
                // order.
                if (count[0] > 1) quicksort(start[0], count[0]);
                for (unsigned b = 1; b < 256; ++b)
                    if (count[b] > 1) stack[sp++] = {start[b], count[b], t.d + 1};
                break;
            }
        }
    }
};

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
    skey *keys = nullptr;
    if (tail) {
        // The keys and, behind them, the radix pass's list of ranges.
        if (tail > (SIZE_MAX - kRadixStack * sizeof(rtask)) / sizeof(skey)) return no_memory(fname, SIZE_MAX);
        const size_t bytes = tail * sizeof(skey) + kRadixStack * sizeof(rtask);
        keys = static_cast<skey *>(acl__malloc(bytes));
        if (!keys) return no_memory(fname, bytes);
        acl__advise_large(keys, bytes);
        size_t m = 0;
        for (uint32_t i = sorted_upto; i < v.n; ++i)
            if (v.ents[i].flags & kPresent) keys[m++].i = i;
        sorter{keys, v.ents, v.arena}.sort(tail, reinterpret_cast<rtask *>(keys + tail));
    }
    // The tail's entries and identifiers are reached in sorted order, which
    // is no order in memory: fetched ahead, the misses overlap instead of
    // each costing a full trip to memory.
    constexpr size_t kAhead = 16;
    uint32_t i = 0;
    size_t j = 0;
    for (;;) {
        if (j + 2 * kAhead < tail) __builtin_prefetch(&v.ents[keys[j + 2 * kAhead].i]);
        if (j + kAhead < tail) __builtin_prefetch(v.arena + v.ents[keys[j + kAhead].i].id_off);
        while (i < sorted_upto && !(v.ents[i].flags & kPresent)) ++i;
        bool have_p = i < sorted_upto, have_t = j < tail;
        if (!have_p && !have_t) break;
        uint32_t next;
        if (have_p && have_t) {
            const ent &ep = v.ents[i], &et = v.ents[keys[j].i];
            next = zo::casecmp_len(v.arena + ep.id_off, ep.id_len, v.arena + et.id_off, et.id_len) <= 0
                       ? i++
                       : keys[j++].i;
        } else {
            next = have_p ? i++ : keys[j++].i;
        }
        if (!f(next)) break;
    }
    std::free(keys);
    return 0;
}

// ---- Growing --------------------------------------------------------------------

// Grow *p (elements of `size` bytes, capacity *cap) to hold `need`, doubling.
bool grow_array(void **p, uint32_t *cap, size_t need, size_t size, size_t *failed) {
    if (need <= *cap) return true;
    size_t nc = *cap ? *cap : 4;
    while (nc < need) nc = nc > SIZE_MAX / 2 ? SIZE_MAX : nc * 2;
    if (nc > UINT32_MAX) nc = UINT32_MAX;
    if (nc < need || nc > SIZE_MAX / size) {
        *failed = SIZE_MAX;
        return false;
    }
    void *q = acl__realloc(*p, nc * size);
    if (!q) {
        *failed = nc * size;
        return false;
    }
    *p = q;
    *cap = static_cast<uint32_t>(nc);
    acl__advise_large(q, nc * size);
    return true;
}

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
    while (ns / 2 < need) ns *= 2;
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
    std::free(b->ents);
    std::free(b->arena);
    std::free(b->idx);
}

// Move a one-entry tree to the growable form, with room for `more` further
// entries and `bytes` further arena bytes.  The block is reallocated, so
// the link to the tree is updated.
int32_t promote(tree **node, size_t more, size_t bytes) {
    static_assert(sizeof(tree) % alignof(big_part) == 0, "big_part follows the header");
    const char *fname = "sec__add_acle_to_tree";
    tree *t = *node;
    const size_t inl = t->e0.id_off + size_t{t->e0.id_len} + 1;
    const size_t keep = t->mechlen + 1u;
    size_t failed = 0;
    big_part nb{};
    bool ok = grow_array(reinterpret_cast<void **>(&nb.ents), &nb.cap, more >= UINT32_MAX ? UINT32_MAX : 1 + more,
                         sizeof(ent), &failed);
    size_t want = inl + bytes < 64 ? 64 : inl + bytes;
    if (ok) ok = grow_array(reinterpret_cast<void **>(&nb.arena), &nb.arena_cap,
                            want > UINT32_MAX ? UINT32_MAX : want, 1, &failed);
    tree *nt = nullptr;
    if (ok) {
        std::memcpy(nb.arena, inline_bytes(t), inl);
        nt = static_cast<tree *>(acl__realloc(t, sizeof(tree) + sizeof(big_part) + keep));
        if (!nt) failed = sizeof(tree) + sizeof(big_part) + keep;
    }
    if (!nt) {
        free_big(&nb);
        return no_memory(fname, failed);
    }
    char *base = reinterpret_cast<char *>(nt) + sizeof(tree);
    std::memmove(base + sizeof(big_part), base, keep);  // mech0 moves behind the big_part
    nb.arena_len = static_cast<uint32_t>(inl);
    nb.ents[0] = nt->e0;
    nb.n = 1;
    nb.n_present = (nt->e0.flags & kPresent) ? 1 : 0;
    nb.sorted_upto = 1;
    nb.descending = true;
    nt->big = reinterpret_cast<big_part *>(base);
    std::memcpy(static_cast<void *>(nt->big), &nb, sizeof nb);
    *node = nt;
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

struct new_entry {
    unsigned char type;
    uint32_t perm;
    const char *mech;  // NUL-terminated at mechlen ("" for types without one)
    size_t mechlen;
    const char *id;    // NUL-terminated at idlen ("" for types without one)
    size_t idlen;
    // Hashed only when an index is consulted.
    mutable uint32_t hash = 0;
    mutable bool hashed = false;
    uint32_t h() const {
        if (!hashed) hash = fold_hash(id, idlen) & kHashMask, hashed = true;
        return hash;
    }
};

int32_t duplicate(sec_boolean_t single, const new_entry &ne, ent &stored) {
    char letter = acl__type_letter(ne.type);
    if (single) {
        switch (ne.type) {
        case SEC_ACLE_TYPE_UNAUTHENTICATED:
        case SEC_ACLE_TYPE_ANYOTHER: return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::DUPLICATE_SINGLE_ACLE, letter);
        case SEC_ACLE_TYPE_GROUP: return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::DUPLICATE_GROUP, letter, ne.id);
        default: return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::DUPLICATE_ACLE, letter, ne.mech, ne.id);
        }
    }
    stored.perm = ne.perm;
    using namespace acl::trace;
    const char *mech = (has_mech(ne.type) || ne.type == SEC_ACLE_TYPE_GROUP) ? ne.mech : "<none>";
    const char *id = ne.type == SEC_ACLE_TYPE_USER ? ne.id : "<none>";
    point(INFO, 113, {str(type_name(ne.type)), str(mech), str(id)});
    return 0;
}

// Create a one-entry tree.
int32_t create(const new_entry &ne, tree **node) {
    const size_t mechlen = has_mech(ne.type) ? ne.mechlen : 0;
    size_t size = sizeof(tree) + mechlen + 1;
    if (ne.idlen > UINT32_MAX - mechlen - 2 || size + ne.idlen + 1 < size)
        return no_memory("sec__add_acle_to_tree", SIZE_MAX);
    size += ne.idlen + 1;
    auto *t = static_cast<tree *>(acl__malloc(size));
    if (!t) return no_memory("sec__add_acle_to_tree", size);
    t->big = nullptr;
    t->type = ne.type;
    t->mechlen = static_cast<unsigned char>(mechlen);
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

int32_t insert(sec_boolean_t single, const new_entry &ne, tree **node) {
    const char *fname = "sec__add_acle_to_tree";
    tree *t = *node;
    if (!t) return create(ne, node);
    if (t->type != ne.type || (has_mech(t->type) && (ne.mechlen != t->mechlen ||
                                                     !fold_eq(inline_bytes(t), ne.mech, ne.mechlen))))
        return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, fname, 2, ne.type);

    if (!t->big) {
        if ((t->e0.flags & kPresent) && (!has_id(t->type) || small_matches(t, ne)))
            return duplicate(single, ne, t->e0);
        if (int32_t rc = promote(node, 1, ne.idlen + 1 + ne.mechlen + 1)) return rc;
        t = *node;
    }
    big_part *b = t->big;
    const uint32_t i = b->n;
    size_t failed = 0;
    bool found = false;
    size_t slot = 0;
    int last_cmp = 0;  // previous identifier against the new one
    if (!has_id(t->type)) {
        uint32_t f = first_present(t);
        if (f < b->n) return duplicate(single, ne, b->ents[f]);
    } else {
        // Once neither direction holds the comparison tells nothing more.
        if (b->sorted_upto == i || b->descending)
            last_cmp = zo::casecmp_len(b->arena + b->ents[i - 1].id_off, b->ents[i - 1].id_len, ne.id, ne.idlen);
        const bool in_run = (last_cmp < 0 && b->sorted_upto == i) || (last_cmp > 0 && b->descending);
        if (!b->idx && !in_run) {
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
    const bool own = has_mech(t->type) && std::memcmp(ne.mech, inline_bytes(t), t->mechlen) != 0;
    const size_t add = (own ? t->mechlen + 1 : 0) + ne.idlen + 1;
    if (i == UINT32_MAX || add > UINT32_MAX - size_t{b->arena_len}) return no_memory(fname, SIZE_MAX);
    if (!grow_array(reinterpret_cast<void **>(&b->ents), &b->cap, size_t{i} + 1, sizeof(ent), &failed) ||
        !grow_array(reinterpret_cast<void **>(&b->arena), &b->arena_cap, size_t{b->arena_len} + add, 1,
                    &failed))
        return no_memory(fname, failed);
    if (b->idx && !found) {
        uint64_t *old = b->idx;
        if (!grow_index(b, size_t{b->idx_used} + 1, &failed)) return no_memory(fname, failed);
        if (b->idx != old) slot = probe(b, ne, &found);
    }

    char *p = b->arena + b->arena_len;
    if (own) {
        std::memcpy(p, ne.mech, t->mechlen);
        p[t->mechlen] = '\0';
        p += t->mechlen + 1;
    }
    std::memcpy(p, ne.id, ne.idlen);
    p[ne.idlen] = '\0';
    b->ents[i] = ent{static_cast<uint32_t>(p - b->arena), static_cast<uint32_t>(ne.idlen), ne.perm,
                     ne.h() | kPresent | (own ? kOwnMech : 0)};
    b->arena_len += static_cast<uint32_t>(add);
    if (b->idx) {
        if (!found) ++b->idx_used;
        b->idx[slot] = slot_value(ne.h(), i);  // a removed entry of the same identifier gives up its slot
    }
    if (has_id(t->type)) {
        if (b->sorted_upto == i && last_cmp < 0) b->sorted_upto = i + 1;
        b->descending = b->descending && last_cmp > 0;
    }
    b->n = i + 1;
    ++b->n_present;
    return 0;
}

bool entry_parts(const sec_acle_desc *acle, new_entry *ne) {
    ne->type = acle->type;
    ne->perm = acle->perm;
    // The record's mechanism is a 17-byte field; one without its NUL is
    // taken as its first 16 characters rather than read past.
    ne->mech = has_mech(acle->type) ? acle->mech : "";
    ne->mechlen = has_mech(acle->type) ? strnlen(acle->mech, kMechMax) : 0;
    // A record of a type with an identifier but none given is taken as an
    // empty identifier; the types without one drop any they carry.
    ne->id = has_id(acle->type) && acle->id ? acle->id : "";
    ne->idlen = std::strlen(ne->id);
    return acl__valid_type(acle->type);
}

// ---- The array of trees ---------------------------------------------------------

struct trees_index {
    uint64_t *slots;  // key hash (upper half), tree slot + 1 (lower half); 0 free
    uint32_t mask;
    uint32_t used;
    size_t cap;   // capacity of the trees array
    int32_t last; // slot of the previous insertion, checked first
};

uint32_t tree_key_hash(unsigned char type, const char *mech, size_t mechlen) {
    return fold_hash(mech, mechlen, type);
}

bool tree_matches(const tree *t, unsigned char type, const char *mech, size_t mechlen) {
    if (!t || t->type != type) return false;
    if (!has_mech(type)) return true;
    return t->mechlen == mechlen && fold_eq(inline_bytes(t), mech, mechlen);
}

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
        if (const tree *t = trees->trees[s]) {
            index_put(x, slot_value(tree_key_hash(t->type, inline_bytes(t), t->mechlen), static_cast<uint32_t>(s)));
            ++x->used;
        }
    return 0;
}

}  // namespace

void acl__advise_large(void *p, size_t n) {
#ifdef MADV_HUGEPAGE
    // Arrays of a million entries are walked and probed at random: with 4 KiB
    // pages nearly every access is a TLB miss and every fresh page a fault.
    // Only whole 2 MiB stretches inside the block are advised; the advice
    // changes no content and a refusal is harmless.
    constexpr uintptr_t kHuge = uintptr_t{2} << 20;
    if (!p || n < 2 * kHuge) return;
    uintptr_t a = (reinterpret_cast<uintptr_t>(p) + kHuge - 1) & ~(kHuge - 1);
    uintptr_t e = (reinterpret_cast<uintptr_t>(p) + n) & ~(kHuge - 1);
    if (e > a) madvise(reinterpret_cast<void *>(a), e - a, MADV_HUGEPAGE);
#else
    (void)p;
    (void)n;
#endif
}

// ---- Public operations ------------------------------------------------------------

int32_t sec__add_acle_to_tree(sec_boolean_t single, const sec_acle_desc *acle, sec_acltree_t *node) {
    if (!acle) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__add_acle_to_tree", 2, 0);
    if (!node) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__add_acle_to_tree", 3, 0);
    new_entry ne;
    if (!entry_parts(acle, &ne)) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::BAD_ACLE_TYPE, acle->type);
    return insert(single, ne, node);
}

int32_t acl__tree_insert(sec_acltree_t *node, sec_boolean_t single, unsigned char type, uint32_t perm,
                         const char *mech, size_t mechlen, const char *id, size_t idlen) {
    new_entry ne;
    ne.type = type;
    ne.perm = perm;
    ne.mech = has_mech(type) ? mech : "";
    ne.mechlen = has_mech(type) ? mechlen : 0;
    ne.id = has_id(type) ? id : "";
    ne.idlen = has_id(type) ? idlen : 0;
    return insert(single, ne, node);
}

int32_t acl__tree_reserve(sec_acltree_t *node, size_t entries, size_t bytes) {
    sec_acltree_t t = node ? *node : nullptr;
    if (!t) return 0;
    if (!t->big) return promote(node, entries, bytes);
    big_part *b = t->big;
    size_t failed = 0;
    size_t ne = size_t{b->n} + entries, nb = size_t{b->arena_len} + bytes;
    if (ne > UINT32_MAX) ne = UINT32_MAX;
    if (nb > UINT32_MAX) nb = UINT32_MAX;
    if (!grow_array(reinterpret_cast<void **>(&b->ents), &b->cap, ne, sizeof(ent), &failed) ||
        !grow_array(reinterpret_cast<void **>(&b->arena), &b->arena_cap, nb, 1, &failed) ||
        (b->idx && !grow_index(b, size_t{b->idx_used} + entries, &failed)))
        return no_memory("sec__add_acle_to_tree", failed);
    return 0;
}

int32_t sec__add_acle_to_trees(const sec_acle_desc *acle, acl__trees_s *trees) {
    const char *fname = "sec__add_acle_to_trees";
    if (!acle) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, fname, 1, 0);
    if (!trees) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, fname, 2, 0);
    new_entry ne;
    if (!entry_parts(acle, &ne)) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::BAD_ACLE_TYPE, acle->type);

    auto *x = static_cast<trees_index *>(trees->index);
    if (!x) {
        x = static_cast<trees_index *>(acl__calloc(1, sizeof(trees_index)));
        if (!x) return no_memory(fname, sizeof(trees_index));
        x->cap = static_cast<size_t>(trees->nooftrees);  // an array handed in holds exactly its count
        x->last = -1;
        trees->index = x;
    }
    if (x->last >= 0 && x->last < trees->nooftrees &&
        tree_matches(trees->trees[x->last], ne.type, ne.mech, ne.mechlen))
        return insert(1, ne, &trees->trees[x->last]);
    // Index every tree before the first search (the array may have been
    // handed in already filled).
    if (!x->slots && trees->nooftrees > 0)
        if (int32_t rc = index_room(x, trees, 0)) return rc;

    const uint32_t h = tree_key_hash(ne.type, ne.mech, ne.mechlen);
    if (x->slots) {
        for (size_t s = slot_of(h, x->mask); x->slots[s]; s = (s + 1) & x->mask) {
            if (slot_hash(x->slots[s]) != h) continue;
            int32_t slot = static_cast<int32_t>(slot_entry(x->slots[s]));
            if (tree_matches(trees->trees[slot], ne.type, ne.mech, ne.mechlen)) {
                x->last = slot;
                return insert(1, ne, &trees->trees[slot]);
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
    int32_t rc = insert(1, ne, &trees->trees[slot]);
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

int32_t sec__del_acle_from_tree(const sec_acle_desc *acle, sec_acltree_t t) {
    if (!acle) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__del_acle_from_tree", 1, 0);
    new_entry ne;
    entry_parts(acle, &ne);
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
    std::free(t);
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

int32_t acl__tree_visit_named(sec_acltree_s *t, acl__tree_visit_fn fn, void *ctx, const char *fname) {
    if (!t || !fn) return 0;
    tview v = view_of(t);
    return for_each_in_order(t, fname, [&](uint32_t i) {
        acl__tree_entry_view e = make_view(t, v, v.ents[i]);
        return fn(&e, ctx);
    });
}

int32_t acl__tree_visit(sec_acltree_s *t, acl__tree_visit_fn fn, void *ctx) {
    return acl__tree_visit_named(t, fn, ctx, "acl__tree_visit");
}

void acl__tree_stats(const sec_acltree_s *ct, size_t *count, uint64_t *id_bytes, size_t *max_idlen) {
    *count = 0;
    *id_bytes = 0;
    *max_idlen = 0;
    if (!ct) return;
    tview v = view_of(const_cast<tree *>(ct));
    for (uint32_t i = 0; i < v.n; ++i) {
        const ent &e = v.ents[i];
        if (!(e.flags & kPresent)) continue;
        ++*count;
        *id_bytes += e.id_len;
        if (e.id_len > *max_idlen) *max_idlen = e.id_len;
    }
}
