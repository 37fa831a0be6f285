// Ordering identifiers (see ryacl_acl_sort.h): a most-significant-byte
// radix pass over the first sixteen folded bytes, then a multikey
// quicksort of what is still tied.
#include "ryacl_acl_sort.h"

#include <bit>
#include <cstring>
#include <utility>

#include "ry_zo_int.h"

namespace {

using zo::fold;
using zo::fold8;
using skey = acl__sort_key;

// Multikey quicksort on eight folded bytes at a time: the keys of a range
// are compared as integers, and only a range whose keys tie moves on to the
// next eight bytes.  Identifiers of a real ACL share long prefixes
// ("user0001..."), which would make a plain comparison sort chase every
// string through memory.

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
    const acl__id_table &ids;

    uint32_t ref(uint32_t i, size_t field) const {
        uint32_t v;
        std::memcpy(&v, static_cast<const unsigned char *>(ids.refs) + i * ids.stride + field * sizeof v, sizeof v);
        return v;
    }
    const char *text(uint32_t i) const { return ids.arena + ref(i, 0); }
    size_t length(uint32_t i) const { return ref(i, 1); }

    // Sixteen bytes per load: most identifiers part within them, so a tied
    // range usually moves on to its next eight bytes without going back to
    // the arena (where, once partitioned, every access would be a miss).
    void load(size_t lo, size_t n, size_t depth) {
        for (size_t j = lo; j < lo + n; ++j) {
            const char *s = text(a[j].i);
            const size_t len = length(a[j].i);
            a[j].k = chunk(s, len, depth);
            a[j].next = chunk(s, len, depth + 8);
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
        size_t from = depth + 8;
        const char *p = text(x.i), *q = text(y.i);
        size_t lp = length(x.i), lq = length(y.i);
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

    // How many of the sixteen key bytes every entry of [lo, lo + n) shares
    // with the first, knowing that the first `from` are shared.
    unsigned shared_bytes(size_t lo, size_t n, unsigned from) const {
        uint64_t dk = 0, dn = 0;
        for (size_t j = lo + 1; j < lo + n; ++j) {
            dk |= a[j].k ^ a[lo].k;
            dn |= a[j].next ^ a[lo].next;
        }
        const unsigned same = dk ? static_cast<unsigned>(std::countl_zero(dk)) / 8
                                 : 8 + (dn ? static_cast<unsigned>(std::countl_zero(dn)) / 8 : 8);
        return same > from ? same : from;
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
                    // One shared byte: find in one pass how many the whole
                    // range shares ("user0..." shares five), rather than a
                    // counting pass for each.
                    t.d = shared_bytes(t.lo, t.n, t.d + 1);
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

}  // namespace

size_t acl__sort_area_bytes(size_t n) { return n * sizeof(skey) + kRadixStack * sizeof(rtask); }

size_t acl__sort_max_keys() { return (SIZE_MAX - kRadixStack * sizeof(rtask)) / sizeof(skey); }

void acl__sort_ids(acl__sort_key *keys, size_t n, const acl__id_table &ids) {
    if (n < 2) return;
    sorter{keys, ids}.sort(n, reinterpret_cast<rtask *>(keys + n));
}
