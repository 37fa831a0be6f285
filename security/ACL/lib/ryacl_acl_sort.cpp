// Ordering identifiers (see ryacl_acl_sort.h): most-significant-byte radix
// passes over the first twelve folded bytes, then a multikey quicksort of
// what is still tied.
#include "ryacl_acl_sort.h"

#include <bit>
#include <cstring>
#include <utility>

#include "ry_zo_int.h"

namespace {

using zo::fold;
using zo::fold8;
using skey = acl__sort_key;
static_assert(sizeof(skey) == 16, "a key is two to a cache line's quarter");

// Folded bytes a key holds: eight in k, four in k2.
constexpr unsigned kKeyBytes = 12;

// Folded bytes [depth, depth + 8) of a text of len bytes as a big-endian
// integer, zero past its end: integer order is then text order.
uint64_t chunk(const char *s, size_t len, size_t depth) {
    if (depth >= len) return 0;
    uint64_t v = 0;
    if (len - depth >= 8) v = zo::load8(s + depth);
    else std::memcpy(&v, s + depth, len - depth);
    v = fold8(v);
    if constexpr (std::endian::native == std::endian::little) v = __builtin_bswap64(v);
    return v;
}

bool key_less(const skey &x, const skey &y) { return x.k != y.k ? x.k < y.k : x.k2 < y.k2; }
bool key_equal(const skey &x, const skey &y) { return x.k == y.k && x.k2 == y.k2; }
// The text ended inside the key (no identifier holds a NUL): keys that are
// equal and end are equal texts.
bool key_ends(const skey &x) { return (x.k2 & 0xff) == 0; }

// Byte d (0 to 11) of the key.
unsigned byte_at(const skey &x, unsigned d) {
    return d < 8 ? static_cast<unsigned>(x.k >> (56 - 8 * d)) & 0xff
                 : static_cast<unsigned>(x.k2 >> (24 - 8 * (d - 8))) & 0xff;
}

// A range of keys, in the first or the second half of the work area, whose
// entries share their first d folded bytes.
struct rtask {
    size_t lo, n;
    unsigned d;
    bool in_b;
};
// Ranges this small sort faster by comparison than by another pass; up to
// kRadixMin keys, only when the byte at hand takes fewer values than there
// are keys (the digits of "user0000123" do).
constexpr size_t kLeafMax = 8;
constexpr size_t kRadixMin = 32;
// A range may be distributed on two bytes at once: a million identifiers
// sharing "user" then fall into a hundred ranges of ten thousand that sort
// in cache, where one byte leaves ten of a hundred thousand for another
// pass through memory, and each range of ten thousand again needs two
// passes, not four.  Only while the two bytes take few values: over a
// range larger than the cache, moves scattered to thousands of places
// would each miss it; and counting them must not cost more than the keys.
constexpr size_t kWideMin = 8192;         // arrays given the two-byte counters
constexpr size_t kWideRange = 2048;       // ranges worth a two-byte count
constexpr size_t kWideInCache = 32768;    // keys of a range that stays in cache
constexpr size_t kWideDigits = size_t{1} << 16;
constexpr size_t kWideMaxUsed = 4096;     // values taken, in cache
constexpr size_t kWideMaxUsedFar = 1024;  // beyond it
// Ranges waiting: at most kWideMaxUsed from each of twelve levels, and,
// since each holds more than kLeafMax keys of its own, at most
// n / (kLeafMax + 1).  Sized by n, the area of a small tree stays small: a
// million-entry file of 65,534 sub-ACLs sorts each one in a block the
// allocator recycles without consolidating its free lists every time.
size_t radix_stack(size_t n) {
    const size_t by_levels = kKeyBytes * kWideMaxUsed + 1, by_keys = n / (kLeafMax + 1) + 1;
    return by_keys < by_levels ? by_keys : by_levels;
}
// Counters of the two-byte passes, behind the stack; positions in them are
// 32-bit.
size_t wide_bytes(size_t n) {
    return n >= kWideMin && n <= UINT32_MAX ? kWideDigits * sizeof(uint32_t) : 0;
}

struct sorter {
    skey *a;  // the keys, and where they end up
    skey *b;  // as many again: a pass moves a range from one to the other
    const acl__id_table &ids;

    uint32_t ref(uint32_t i, size_t field) const {
        uint32_t v;
        std::memcpy(&v, static_cast<const unsigned char *>(ids.refs) + i * ids.stride + field * sizeof v, sizeof v);
        return v;
    }
    const char *text(uint32_t i) const { return ids.arena + ref(i, 0); }
    size_t length(uint32_t i) const { return ref(i, 1); }

    // Keys of a[lo, lo + n) from `depth` on, and how many bytes of them
    // all keys share (12: all).  The texts may lie anywhere (the entries of
    // one sub-ACL are spread through the file they were parsed from):
    // fetched ahead, their misses overlap.
    unsigned load(size_t lo, size_t n, size_t depth) {
        constexpr size_t kAhead = 8;
        auto fetch = [&](size_t j) {
            const size_t len = length(a[j].i);
            if (depth >= len) return;
            const char *s = text(a[j].i);
            __builtin_prefetch(s + depth);
            __builtin_prefetch(s + (len - depth > kKeyBytes ? depth + kKeyBytes : len));
        };
        for (size_t j = lo; j < lo + n && j < lo + kAhead; ++j) fetch(j);
        uint64_t dk = 0;
        uint32_t dk2 = 0;
        for (size_t j = lo; j < lo + n; ++j) {
            if (j + kAhead < lo + n) fetch(j + kAhead);
            const char *s = text(a[j].i);
            const size_t len = length(a[j].i);
            a[j].k = chunk(s, len, depth);
            a[j].k2 = static_cast<uint32_t>(chunk(s, len, depth + 8) >> 32);
            dk |= a[j].k ^ a[lo].k;
            dk2 |= a[j].k2 ^ a[lo].k2;
        }
        return differing_from(dk, dk2);
    }
    // The first key byte in which the keys ORed into dk and dk2 differ (12:
    // none).
    static unsigned differing_from(uint64_t dk, uint32_t dk2) {
        return dk ? static_cast<unsigned>(std::countl_zero(dk)) / 8
                  : 8 + (dk2 ? static_cast<unsigned>(std::countl_zero(dk2)) / 8 : 4);
    }
    // Full order of two entries whose first `depth` folded bytes are equal
    // and whose keys hold the next twelve.
    bool less(const skey &x, const skey &y, size_t depth) const {
        if (!key_equal(x, y)) return key_less(x, y);
        if (key_ends(x)) return x.i < y.i;  // equal texts: keep insertion order
        const char *p = text(x.i), *q = text(y.i);
        const size_t lp = length(x.i), lq = length(y.i);
        for (size_t j = depth + kKeyBytes;; ++j) {
            int cp = j < lp ? fold(static_cast<unsigned char>(p[j])) : -1;
            int cq = j < lq ? fold(static_cast<unsigned char>(q[j])) : -1;
            if (cp != cq) return cp < cq;
            if (cp < 0) return x.i < y.i;
        }
    }
    void insertion(skey *s, size_t lo, size_t n, size_t depth) const {
        for (size_t j = lo + 1; j < lo + n; ++j) {
            skey v = s[j];
            size_t m = j;
            while (m > lo && less(v, s[m - 1], depth)) {
                s[m] = s[m - 1];
                --m;
            }
            s[m] = v;
        }
    }
    // Fallback when partitioning stops making progress, and the order of
    // equal texts that partitioning has shuffled: O(n log n) always.
    void heapsort(size_t lo, size_t n, size_t depth) const {
        skey *h = a + lo;
        auto sift = [&](size_t root, size_t end) {
            for (;;) {
                size_t c = 2 * root + 1;
                if (c >= end) return;
                if (c + 1 < end && less(h[c], h[c + 1], depth)) ++c;
                if (!less(h[root], h[c], depth)) return;
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
    void small_sort(size_t lo, size_t n, size_t depth) const {
        if (n <= 16) insertion(a, lo, n, depth);
        else heapsort(lo, n, depth);
    }

    // Multikey quicksort of a[lo, lo + n), whose keys hold bytes
    // [depth, depth + 12): a range is partitioned on its keys as integers,
    // and only a range whose keys tie moves on to the next twelve bytes.
    // Identifiers of a real ACL share long prefixes ("user0001..."), which
    // would make a plain comparison sort chase every string through memory.
    void quicksort(size_t lo, size_t n, size_t depth) {
        struct task {
            size_t lo, n, depth;
            unsigned budget;
        };
        // Continuing with the smallest piece and pushing the others keeps the
        // stack within two entries per halving of the range: 2 * 32 + slack.
        task stack[72];
        size_t sp = 0;
        unsigned budget0 = 2;
        for (size_t m = n; m > 1; m >>= 1) budget0 += 2;
        task cur{lo, n, depth, budget0};
        for (;;) {
            while (cur.n > 1) {
                if (cur.n <= 16) {
                    insertion(a, cur.lo, cur.n, cur.depth);
                    break;
                }
                if (cur.budget == 0) {
                    heapsort(cur.lo, cur.n, cur.depth);
                    break;
                }
                const skey &x = a[cur.lo], &y = a[cur.lo + cur.n / 2], &z = a[cur.lo + cur.n - 1];
                const skey p = key_less(x, y) ? (key_less(y, z) ? y : (key_less(x, z) ? z : x))
                                              : (key_less(x, z) ? x : (key_less(y, z) ? z : y));
                size_t lt = cur.lo, j = cur.lo, gt = cur.lo + cur.n;
                while (j < gt) {
                    if (key_less(a[j], p)) std::swap(a[lt++], a[j++]);
                    else if (key_less(p, a[j])) std::swap(a[j], a[--gt]);
                    else ++j;
                }
                task pieces[3] = {{cur.lo, lt - cur.lo, cur.depth, cur.budget - 1},
                                  {lt, gt - lt, cur.depth + kKeyBytes, budget0},
                                  {gt, cur.lo + cur.n - gt, cur.depth, cur.budget - 1}};
                // Keys that end inside these twelve bytes are equal texts,
                // put back in insertion order.  Else the tied range goes on
                // with its next twelve bytes.
                if (key_ends(p) || pieces[1].n < 2) {
                    if (key_ends(p) && pieces[1].n > 1) small_sort(pieces[1].lo, pieces[1].n, cur.depth);
                    pieces[1].n = 0;
                } else {
                    load(pieces[1].lo, pieces[1].n, pieces[1].depth);
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

    // How many of the twelve key bytes every key of s[lo, lo + n) shares
    // with the first, knowing that the first `from` are shared.
    static unsigned shared_bytes(const skey *s, size_t lo, size_t n, unsigned from) {
        uint64_t dk = 0;
        uint32_t dk2 = 0;
        for (size_t j = lo + 1; j < lo + n; ++j) {
            dk |= s[j].k ^ s[lo].k;
            dk2 |= s[j].k2 ^ s[lo].k2;
        }
        const unsigned same = differing_from(dk, dk2);
        return same > from ? same : from;
    }

    // A range whose order is final: where it must end up.
    void settle(const rtask &t) const {
        if (t.in_b) std::memcpy(a + t.lo, b + t.lo, t.n * sizeof(skey));
    }

    // A distributed range: each bucket either waits on the stack or, when
    // small or made of texts that ended, is finished at once.  `ended`
    // says of a bucket that its texts end inside the bytes distributed on.
    void take_bucket(const rtask &sub, bool ended, rtask *stack, size_t &sp) const {
        if (!ended && sub.n > kLeafMax) {
            stack[sp++] = sub;
            return;
        }
        // Texts that ended are equal, in entry order already.
        if (!ended) insertion(sub.in_b ? b : a, sub.lo, sub.n, 0);
        settle(sub);
    }

    // One pass on the two bytes from t.d of a range of at least kWideRange
    // keys: 1 done, 0 when they take too many values (nothing moved), -1
    // when every key shares them (t.d moved past what they all share).
    // `wide` is zero on entry and on return.
    int wide_pass(rtask &t, uint32_t *wide, rtask *stack, size_t &sp) {
        skey *src = t.in_b ? b : a, *dst = t.in_b ? a : b;
        const unsigned d = t.d;
        auto digit = [d](const skey &x) { return byte_at(x, d) << 8 | byte_at(x, d + 1); };
        unsigned first = kWideDigits - 1, last = 0;
        for (size_t j = t.lo; j < t.lo + t.n; ++j) {
            const unsigned g = digit(src[j]);
            ++wide[g];
            first = g < first ? g : first;
            last = g > last ? g : last;
        }
        if (first == last) {
            wide[first] = 0;
            t.d = shared_bytes(src, t.lo, t.n, d + 2);
            return -1;
        }
        const size_t max_used = t.n <= kWideInCache ? kWideMaxUsed : kWideMaxUsedFar;
        size_t used = 0;
        if (last - first < 2 * t.n)
            for (unsigned g = first; g <= last; ++g) used += wide[g] != 0;
        if (used == 0 || used > max_used) {
            std::memset(wide + first, 0, (last - first + 1) * sizeof *wide);
            return 0;
        }
        // Starts, then (after the moves) ends of the buckets.
        uint32_t at = static_cast<uint32_t>(t.lo);
        for (unsigned g = first; g <= last; ++g) {
            const uint32_t m = wide[g];
            wide[g] = at;
            at += m;
        }
        for (size_t j = t.lo; j < t.lo + t.n; ++j) dst[wide[digit(src[j])]++] = src[j];
        size_t lo = t.lo;
        for (unsigned g = first; g <= last; ++g) {
            const size_t end = wide[g];
            wide[g] = 0;
            if (end == lo) continue;
            // A zero byte: the texts ended at byte d or d + 1.
            take_bucket({lo, end - lo, d + 2, !t.in_b}, g < 256 || (g & 0xff) == 0, stack, sp);
            lo = end;
        }
        return 1;
    }

    // Most significant byte first.  Each pass distributes a range from one
    // half of the work area into the other in one sequential read: the
    // moves of a pass are independent of each other, where moving keys in
    // place would chain every move on the one before.  Distribution is
    // stable, so keys that stay tied keep their (ascending) entry order.
    // Bytes every key of a range shares are stepped over without a pass.
    // Small ranges are sorted by comparison, ranges tied through all twelve
    // bytes by the multikey quicksort from there on.
    void sort(size_t n, rtask *stack, uint32_t *wide) {
        const unsigned d0 = load(0, n, 0);
        size_t sp = 0;
        if (n <= kRadixMin) {
            insertion(a, 0, n, 0);
            return;
        }
        stack[sp++] = {0, n, d0, false};
        if (wide) std::memset(wide, 0, kWideDigits * sizeof *wide);
        // Zero between ranges: a range clears only the buckets its bytes
        // fell in, so the many small ranges near the leaves (ten digits
        // each, say) do not pay for all 256.
        size_t count[256] = {}, next[256];
        while (sp) {
            rtask t = stack[--sp];
            skey *src = t.in_b ? b : a, *dst = t.in_b ? a : b;
            for (;;) {
                if (t.d >= kKeyBytes) {
                    settle(t);
                    // Equal texts are in entry order already.
                    if (!key_ends(a[t.lo])) {
                        load(t.lo, t.n, kKeyBytes);
                        quicksort(t.lo, t.n, kKeyBytes);
                    }
                    break;
                }
                if (wide && t.n >= kWideRange && t.d + 1 < kKeyBytes) {
                    const int w = wide_pass(t, wide, stack, sp);
                    if (w > 0) break;
                    if (w < 0) continue;
                }
                unsigned first = 255, last = 0;
                for (size_t j = t.lo; j < t.lo + t.n; ++j) {
                    const unsigned c = byte_at(src[j], t.d);
                    ++count[c];
                    first = c < first ? c : first;
                    last = c > last ? c : last;
                }
                if (t.n <= kRadixMin && last - first >= t.n) {
                    for (unsigned c = first; c <= last; ++c) count[c] = 0;
                    insertion(src, t.lo, t.n, 0);
                    settle(t);
                    break;
                }
                if (first == last) {
                    // One shared byte: find in one pass how many the whole
                    // range shares ("user0..." shares five), rather than a
                    // counting pass for each.
                    count[first] = 0;
                    t.d = shared_bytes(src, t.lo, t.n, t.d + 1);
                    continue;
                }
                for (size_t c = first, at = t.lo; c <= last; ++c) {
                    next[c] = at;
                    at += count[c];
                }
                for (size_t j = t.lo; j < t.lo + t.n; ++j) dst[next[byte_at(src[j], t.d)]++] = src[j];
                for (unsigned c = first; c <= last; ++c) {
                    const size_t m = count[c];
                    count[c] = 0;
                    // Bucket 0 holds identifiers that end here (none holds
                    // a NUL).
                    if (m) take_bucket({next[c] - m, m, t.d + 1, !t.in_b}, c == 0, stack, sp);
                }
                break;
            }
        }
    }
};

}  // namespace

size_t acl__sort_area_bytes(size_t n) {
    return 2 * n * sizeof(skey) + radix_stack(n) * sizeof(rtask) + wide_bytes(n);
}

size_t acl__sort_max_keys() {
    return (SIZE_MAX - radix_stack(SIZE_MAX) * sizeof(rtask) - kWideDigits * sizeof(uint32_t)) / (2 * sizeof(skey));
}

void acl__sort_ids(acl__sort_key *keys, size_t n, const acl__id_table &ids) {
    if (n < 2) return;
    auto *stack = reinterpret_cast<rtask *>(keys + 2 * n);
    auto *wide = wide_bytes(n) ? reinterpret_cast<uint32_t *>(stack + radix_stack(n)) : nullptr;
    sorter{keys, keys + n, ids}.sort(n, stack, wide);
}
