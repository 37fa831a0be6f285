// Indexed evaluation: a compiled ACL turned once into hash tables, for the
// services that evaluate one ACL for request after request.  Each answer is
// the one the walk of ryacl_acl_eval.cpp gives on the same bytes (code, mask,
// recorded error, the same handler calls in the same order), found with a
// probe instead of a walk.
//
// What the walk does, and how the index keeps it:
// - It takes the first sub-ACL of a type (and mechanism, without regard to
//   case).  The index records the first one of each, and nothing of later
//   ones, which the walk can never reach.
// - A plain user or group walk stops at the first entry that is not below
//   the name: it grants that entry's mask when it equals the name, else
//   nothing.  The entry it can grant is therefore the first of that
//   identifier, and only if every entry before it orders below it (an
//   entry ordered above the name ends the walk earlier, as happens when the
//   entries are out of order).  The table maps each identifier to its first
//   entry and marks whether that entry orders above all before it.
// - Handlers are looked up in the registry at evaluation time, as the walk
//   does, and walked over the entries in buffer order, which the index
//   keeps in its own copy of the bytes.
//
// The index holds a copy of the buffer, not a pointer into it, and is never
// written after creation, so any number of threads evaluate through it.
#include <sys/auxv.h>

#include <cstddef>
#include <cstring>
#ifdef __SSE2__
#include <emmintrin.h>
#endif

#include "ry_zo_int.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_entry.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_init.h"

namespace {

__extension__ typedef unsigned __int128 u128;

constexpr uint64_t kMixA = 0x9e3779b97f4a7c15ull;
constexpr uint64_t kMixB = 0xd6e8feb86659fd93ull;
constexpr uint64_t kMixC = 0xa0761d6478bd642full;

// The 64-bit halves of a full product folded together: every input bit
// reaches most output bits in one multiplication.
inline uint64_t mum(uint64_t a, uint64_t b) {
    const u128 r = static_cast<u128>(a) * b;
    return static_cast<uint64_t>(r) ^ static_cast<uint64_t>(r >> 64);
}

// A secret of this process, from the random bytes the kernel hands every
// program: identifiers chosen to collide in one process's tables cannot be
// computed from outside it.
uint64_t process_seed() {
    static const uint64_t seed = [] {
        uint64_t s = kMixC;
        if (const void *r = reinterpret_cast<const void *>(getauxval(AT_RANDOM))) {
            uint64_t w[2] = {};
            std::memcpy(w, r, sizeof w);
            s ^= mum(w[0] ^ kMixA, w[1] ^ kMixB);
        }
        return s;
    }();
    return seed;
}

// The first 32 bytes of an identifier as the comparison sees them: ASCII
// capitals folded, bytes past its end zero.
struct head32 {
    uint64_t a, b, c, d;
};
inline head32 head_of(const char *p, size_t len) {
    char buf[32] = {};
    std::memcpy(buf, p, len < 32 ? len : 32);
    return {zo::fold8(zo::load8(buf)), zo::fold8(zo::load8(buf + 8)), zo::fold8(zo::load8(buf + 16)),
            zo::fold8(zo::load8(buf + 24))};
}

// Hash of an identifier as the comparison sees it, so identifiers that
// compare equal hash equal: its head in two independent products, then 8
// bytes at a time past 32.
inline uint64_t head_hash(const head32 &k, size_t len, uint64_t seed) {
    // Every factor keyed: no chosen text can zero one for every seed.
    return mum(k.a ^ seed, k.b ^ seed ^ kMixA) + mum(k.c ^ seed ^ kMixB, k.d ^ kMixC ^ len);
}
uint64_t text_hash(const head32 &k, const char *p, size_t len, uint64_t seed) {
    uint64_t h = head_hash(k, len, seed);
    for (size_t i = 32; i < len; i += 8) {
        uint64_t w = 0;
        std::memcpy(&w, p + i, len - i < 8 ? len - i : 8);
        h = mum(h ^ zo::fold8(w), kMixB);
    }
    return h;
}

// Order of two identifiers as the comparison gives it, from the first 16
// bytes of their heads where those differ.
struct head16 {
    uint64_t a, b;
};
inline int order(const head32 &x, const char *p, size_t plen, const head16 &y, const char *q, size_t qlen) {
    if (x.a != y.a) return __builtin_bswap64(x.a) < __builtin_bswap64(y.a) ? -1 : 1;
    if (x.b != y.b) return __builtin_bswap64(x.b) < __builtin_bswap64(y.b) ? -1 : 1;
    if (plen <= 16 && qlen <= 16) return 0;
    return zo::casecmp_len(p, plen, q, qlen);
}

// Slot of an identifier table: the low bits of its hash with bit 0 telling
// whether the walk reaches the entry, and the entry's offset in the copy
// (0: empty; no entry starts in the ACL header).
struct id_slot {
    uint32_t key;
    uint32_t off;
};
constexpr uint32_t kReached = 1;

// A table of n slots takes its home slots from the first n - kSpill: the
// last slots are there so that the four from a home slot on always lie in
// the table (creation reads them at once).  Probes wrap at n.
constexpr uint32_t kSpill = 3;
inline uint32_t slot_of(uint64_t h, uint32_t n) {
    return static_cast<uint32_t>((static_cast<uint64_t>(static_cast<uint32_t>(h >> 32)) * (n - kSpill)) >> 32);
}
inline bool same_key(uint32_t key, uint64_t h) { return ((key ^ static_cast<uint32_t>(h)) & ~kReached) == 0; }

// A sub-ACL the walk can find: the first of its type and mechanism.
struct sub_info {
    uint32_t first;  // offset of its first entry in the copy
    uint32_t count;  // its entries
    uint32_t slot0;  // its identifier table (user and group sub-ACLs)
    uint32_t nslots;
};

// Slot of the mechanism directory: a folded mechanism of at most 16 bytes,
// zero-padded, with the sub-ACL's type; sub is the sub-ACL's number plus 1
// (0: empty).
struct mech_slot {
    uint64_t w[2];
    uint32_t type;
    uint32_t sub;
};

constexpr size_t kMaxMech = 16;

// A mechanism as a directory key; false when it is too long to name any
// sub-ACL.
bool mech_key(const char *m, size_t len, uint64_t w[2]) {
    if (len > kMaxMech) return false;
    char buf[kMaxMech] = {};
    std::memcpy(buf, m, len);
    w[0] = zo::fold8(zo::load8(buf));
    w[1] = zo::fold8(zo::load8(buf + 8));
    return true;
}
inline uint64_t mech_hash(const uint64_t w[2], unsigned type, uint64_t seed) {
    return mum(w[0] ^ seed ^ type, w[1] ^ kMixA);
}

// The plain types' sub-ACLs by type: unauthenticated, anyother, group.
int plain_slot(unsigned type) {
    return type == SEC_ACLE_TYPE_UNAUTHENTICATED ? 0 : type == SEC_ACLE_TYPE_ANYOTHER ? 1 : 2;
}

}  // namespace

// The index is two blocks: one holding this record, the sub-ACL records,
// the mechanism directory and the identifier tables, zeroed; and the copy
// of the bytes the walk reads, at the offsets they had in the buffer.
struct sec_acl_index_s {
    unsigned char *bytes;  // the copy
    uint64_t seed;
    sub_info *subs;
    uint32_t nsubs;
    uint32_t by_type[3];   // sub-ACL number plus 1 of types 1, 2, 16; 0: none
    mech_slot *mechs;
    uint32_t mech_mask;
    id_slot *slots;
};

namespace {

constexpr const char *kCreate = "sec_create_acl_index";

void release(sec_acl_index_s *ix) {
    if (!ix) return;
    std::free(ix->bytes);
    std::free(ix);
}

// The sub-ACL of type (and mechanism) that the walk would take, or null.
const sub_info *find_sub(const sec_acl_index_s *ix, unsigned type, const char *mech) {
    if (!acl__type_has_mech(type)) {
        const uint32_t s = ix->by_type[plain_slot(type)];
        return s ? &ix->subs[s - 1] : nullptr;
    }
    uint64_t w[2];
    if (!mech || !mech_key(mech, std::strlen(mech), w)) return nullptr;
    for (uint32_t i = static_cast<uint32_t>(mech_hash(w, type, ix->seed)) & ix->mech_mask;;
         i = (i + 1) & ix->mech_mask) {
        const mech_slot &m = ix->mechs[i];
        if (!m.sub) return nullptr;
        if (m.type == type && m.w[0] == w[0] && m.w[1] == w[1]) return &ix->subs[m.sub - 1];
    }
}

// ---- Creation: validation and indexing in one walk -----------------------
//
// Creation holds the buffer to every rule validation holds it to, but only
// asks whether all hold: the first that fails hands the buffer to
// validation itself, whose record (code, message, arguments) is then the
// answer.  A buffer that keeps every rule is read once: each entry is
// checked, hashed, entered in its table and copied while it is in the
// cache.

// Slots of an identifier table of n entries: loaded to at most two thirds,
// so a miss ends within a few slots.
inline size_t table_size(uint32_t n) { return size_t{n} + n / 2 + 1 + kSpill; }

// The header of the sub-ACL at pos keeps validation's rules: it and its
// length lie in the block, its type is known, its mechanism field is right
// for the type and lies in the block, and its count fits in its room (each
// entry takes its header, and with an identifier at least a NUL).  The
// room of a sub-ACL but the last is its length, since the next must begin
// where its entries end: the counts of all sub-ACLs together stay within
// the block, and so does what is allocated for them.
bool header_ok(const unsigned char *p, size_t len, size_t pos, bool last) {
    if (!acl__fits(pos, ACL_SUBACL_HDR_SIZE, len)) return false;
    const size_t length = acl__load_le32(p + pos);
    if (length > len - pos) return false;
    const unsigned type = p[pos + 4], mlen = p[pos + 9];
    const uint32_t count = acl__load_le32(p + pos + 5);
    if (!acl__valid_type(type)) return false;
    if (acl__type_has_mech(type)) {
        if (mlen < 2 || mlen > 17 || !acl__fits(pos + ACL_SUBACL_HDR_SIZE, mlen, len)) return false;
        if (strnlen(reinterpret_cast<const char *>(p + pos + ACL_SUBACL_HDR_SIZE), mlen) + 1 != mlen) return false;
    } else if (mlen != 0 || (!acl__type_has_id(type) && count > 1)) {
        return false;
    }
    const size_t room = last ? len - pos : length;
    if (room < ACL_SUBACL_HDR_SIZE + mlen) return false;
    return count <= (room - ACL_SUBACL_HDR_SIZE - mlen) / (ACL_ENTRY_HDR_SIZE + (acl__type_has_id(type) ? 1u : 0u));
}

// Every sub-ACL header keeps its rules; *nslots: the slots the user and
// group sub-ACLs could need (a later sub-ACL of a type and mechanism met
// before is counted and never filled).
bool headers_ok(const unsigned char *p, size_t len, size_t *nslots) {
    const unsigned nsub = acl__load_le16(p + 3);
    size_t pos = ACL_HDR_SIZE;
    *nslots = 0;
    for (unsigned k = 0; k < nsub; ++k) {
        if (!header_ok(p, len, pos, k + 1 == nsub)) return false;
        const unsigned type = p[pos + 4];
        if (type == SEC_ACLE_TYPE_USER || type == SEC_ACLE_TYPE_GROUP)
            *nslots += table_size(acl__load_le32(p + pos + 5));
        pos += acl__load_le32(p + pos);
    }
    return true;
}

// The record of the sub-ACL at pos when the walk can find it (the first of
// its type, and mechanism), its first entry and count filled in; null for a
// later one.
sub_info *claim(sec_acl_index_s *ix, const unsigned char *p, size_t pos) {
    const unsigned type = p[pos + 4];
    const size_t mlen = p[pos + 9];
    uint32_t *owner;
    if (!acl__type_has_mech(type)) {
        owner = &ix->by_type[plain_slot(type)];
    } else {
        uint64_t w[2] = {};
        mech_key(reinterpret_cast<const char *>(p + pos + ACL_SUBACL_HDR_SIZE), mlen - 1, w);
        uint32_t i = static_cast<uint32_t>(mech_hash(w, type, ix->seed)) & ix->mech_mask;
        for (; ix->mechs[i].sub; i = (i + 1) & ix->mech_mask) {
            const mech_slot &m = ix->mechs[i];
            if (m.type == type && m.w[0] == w[0] && m.w[1] == w[1]) return nullptr;
        }
        mech_slot &m = ix->mechs[i];
        m.w[0] = w[0];
        m.w[1] = w[1];
        m.type = type;
        owner = &m.sub;
    }
    if (*owner) return nullptr;
    sub_info &s = ix->subs[ix->nsubs];
    *owner = ++ix->nsubs;
    s.first = static_cast<uint32_t>(pos + ACL_SUBACL_HDR_SIZE + mlen);
    s.count = acl__load_le32(p + pos + 5);
    return &s;
}

// Copies the buffer's bytes into the index a stretch behind the walk, while
// they are still in the cache.
struct copier {
    static constexpr size_t kStretch = 64 << 10;
    const unsigned char *from;
    unsigned char *to;
    size_t done = 0;
    void upto(size_t pos) {
        std::memcpy(to + done, from + done, pos - done);
        done = pos;
    }
    void follow(size_t pos) {
        if (pos - done >= kStretch) upto(pos);
    }
};

// The entries of a sub-ACL no table is made for, held to validation's
// rules.  Where they end; 0 when a rule fails.
size_t check_entries(const unsigned char *p, size_t len, size_t pos, uint32_t count, bool has_id, copier &c) {
    for (uint32_t k = 0; k < count; ++k) {
        if (!acl__fits(pos, ACL_ENTRY_HDR_SIZE, len) || p[pos] != 1) return 0;
        const size_t idlen = acl__load_le16(p + pos + 5);
        pos += ACL_ENTRY_HDR_SIZE;
        if (has_id ? idlen == 0 || idlen > len - pos ||
                         strnlen(reinterpret_cast<const char *>(p + pos), idlen) + 1 != idlen
                   : idlen != 0)
            return 0;
        pos += idlen;
        c.follow(pos);
    }
    return pos;
}

// Head and hash of an identifier of n bytes with `room` readable bytes from
// its start (at least n + 1).  False unless its only NUL is at n, as
// validation requires.  Identifiers under 32 bytes with 32 readable are
// read in two vectors, without a branch on their length (a mix of lengths
// would mispredict it); others a byte at a time.
inline bool scan_id(const char *id, size_t n, size_t room, uint64_t seed, head32 *head, uint64_t *h) {
#ifdef __SSE2__
    if (n < 32 && room >= 32) {
        // 32 bytes kept, then 32 dropped: from 32 - n on, the first n bytes of 32.
        alignas(64) static constexpr unsigned char kKeep[64] = {
            255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255,
            255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255, 255};
        const __m128i lo = _mm_loadu_si128(reinterpret_cast<const __m128i *>(id));
        const __m128i hi = _mm_loadu_si128(reinterpret_cast<const __m128i *>(id + 16));
        const __m128i zero = _mm_setzero_si128();
        const uint32_t zeros = static_cast<uint32_t>(_mm_movemask_epi8(_mm_cmpeq_epi8(lo, zero))) |
                               static_cast<uint32_t>(_mm_movemask_epi8(_mm_cmpeq_epi8(hi, zero))) << 16;
        // The first NUL at n: the bit of n is the lowest set.
        if ((zeros & ((uint32_t{2} << n) - 1)) != uint32_t{1} << n) return false;
        const __m128i above = _mm_set1_epi8('A' - 1), below = _mm_set1_epi8('Z' + 1), bit = _mm_set1_epi8(0x20);
        auto fold = [&](__m128i x, const unsigned char *keep) {
            const __m128i upper = _mm_and_si128(_mm_cmpgt_epi8(x, above), _mm_cmpgt_epi8(below, x));
            x = _mm_or_si128(x, _mm_and_si128(upper, bit));
            return _mm_and_si128(x, _mm_loadu_si128(reinterpret_cast<const __m128i *>(keep)));
        };
        const __m128i flo = fold(lo, kKeep + 32 - n), fhi = fold(hi, kKeep + 48 - n);
        *head = {static_cast<uint64_t>(_mm_cvtsi128_si64(flo)),
                 static_cast<uint64_t>(_mm_cvtsi128_si64(_mm_unpackhi_epi64(flo, flo))),
                 static_cast<uint64_t>(_mm_cvtsi128_si64(fhi)),
                 static_cast<uint64_t>(_mm_cvtsi128_si64(_mm_unpackhi_epi64(fhi, fhi)))};
        *h = head_hash(*head, n, seed);
        return true;
    }
#endif
    if (strnlen(id, n + 1) != n) return false;
    *head = head_of(id, n);
    *h = text_hash(*head, id, n, seed);
    return true;
}

// An entry on its way into a table: its key, its offset, its home slot.
struct pending {
    uint32_t key, off, slot;
};

// Whether the identifiers of the entries at offsets a and b are the same.
inline bool same_id(const unsigned char *p, uint32_t a, uint32_t b) {
    return zo::casecmp_len(reinterpret_cast<const char *>(p + a + ACL_ENTRY_HDR_SIZE), acl__load_le16(p + a + 5) - 1u,
                           reinterpret_cast<const char *>(p + b + ACL_ENTRY_HDR_SIZE),
                           acl__load_le16(p + b + 5) - 1u) == 0;
}

// Enter one entry unless an earlier entry of its identifier is there: a
// later one is never the walk's answer.  The four slots from its home are
// looked at together: when one is empty and no key before it is the
// entry's, the entry goes there without a branch on which one (a third of
// home slots are taken by then, at random).
inline void insert(const unsigned char *p, id_slot *t, uint32_t n, const pending &e) {
#ifdef __SSE2__
    static_assert(sizeof(id_slot) == 8 && offsetof(id_slot, off) == 4 && kSpill == 3);
    const __m128 s01 = _mm_castsi128_ps(_mm_loadu_si128(reinterpret_cast<const __m128i *>(t + e.slot)));
    const __m128 s23 = _mm_castsi128_ps(_mm_loadu_si128(reinterpret_cast<const __m128i *>(t + e.slot + 2)));
    const __m128i offs = _mm_castps_si128(_mm_shuffle_ps(s01, s23, _MM_SHUFFLE(3, 1, 3, 1)));
    const __m128i keys = _mm_castps_si128(_mm_shuffle_ps(s01, s23, _MM_SHUFFLE(2, 0, 2, 0)));
    const auto key_bits = static_cast<int>(~kReached);
    const unsigned empty = static_cast<unsigned>(
        _mm_movemask_ps(_mm_castsi128_ps(_mm_cmpeq_epi32(offs, _mm_setzero_si128()))));
    const unsigned same = static_cast<unsigned>(_mm_movemask_ps(_mm_castsi128_ps(_mm_cmpeq_epi32(
        _mm_and_si128(keys, _mm_set1_epi32(key_bits)), _mm_set1_epi32(static_cast<int>(e.key) & key_bits)))));
    const unsigned first = static_cast<unsigned>(__builtin_ctz(empty | 16u));
    if (first < 4 && (same & ((1u << first) - 1)) == 0) {
        t[e.slot + first] = {e.key, e.off};
        return;
    }
#endif
    for (uint32_t i = e.slot;; i = i + 1 == n ? 0 : i + 1) {
        id_slot &slot = t[i];
        if (!slot.off) {
            slot.key = e.key;
            slot.off = e.off;
            return;
        }
        if (((slot.key ^ e.key) & ~kReached) == 0 && same_id(p, slot.off, e.off)) return;
    }
}

// The entries of a user or group sub-ACL the walk can find: held to
// validation's rules and entered in its table of n slots, in order.  Each
// entry's slot is fetched kAhead entries before it is entered, so the
// table's cache misses overlap instead of following one another.  Where
// the entries end; 0 when a rule fails.
size_t fill_entries(const unsigned char *p, size_t len, size_t pos, uint32_t count, id_slot *t, uint32_t n,
                    uint64_t seed, copier &c) {
    constexpr uint32_t kAhead = 32;
    pending ring[kAhead];
    head16 top{};  // the highest identifier so far
    const char *topid = nullptr;
    size_t toplen = 0;
    for (uint32_t k = 0; k < count; ++k) {
        if (!acl__fits(pos, ACL_ENTRY_HDR_SIZE, len) || p[pos] != 1) return 0;
        const size_t idlen = acl__load_le16(p + pos + 5), at = pos + ACL_ENTRY_HDR_SIZE;
        if (idlen == 0 || idlen > len - at) return 0;
        const char *id = reinterpret_cast<const char *>(p + at);
        const size_t idl = idlen - 1;
        head32 head;
        uint64_t h;
        if (!scan_id(id, idl, len - at, seed, &head, &h)) return 0;
        const bool reached = !topid || order(head, id, idl, top, topid, toplen) > 0;
        if (reached) top = {head.a, head.b}, topid = id, toplen = idl;
        const uint32_t slot = slot_of(h, n);
        // The four slots from the home may end on the next line.
        __builtin_prefetch(t + slot, 1);
        __builtin_prefetch(t + slot + kSpill, 1);
        pending &r = ring[k % kAhead];
        if (k >= kAhead) insert(p, t, n, r);
        r = {(static_cast<uint32_t>(h) & ~kReached) | (reached ? kReached : 0), static_cast<uint32_t>(pos), slot};
        pos = at + idlen;
        c.follow(pos);
    }
    for (uint32_t k = count > kAhead ? count - kAhead : 0; k < count; ++k) insert(p, t, n, ring[k % kAhead]);
    return pos;
}

// Walk a buffer whose headers keep their rules: every entry checked, the
// sub-ACLs the walk can find recorded, their tables filled, the bytes up to
// the end of the last entries copied.  False when a rule fails.
bool build(sec_acl_index_s *ix, const unsigned char *p, size_t len) {
    copier c{p, ix->bytes};
    const unsigned nsub = acl__load_le16(p + 3);
    size_t pos = ACL_HDR_SIZE, nslots = 0;
    for (unsigned k = 0; k < nsub; ++k) {
        const unsigned type = p[pos + 4];
        const size_t first = pos + ACL_SUBACL_HDR_SIZE + p[pos + 9];
        const uint32_t count = acl__load_le32(p + pos + 5);
        sub_info *s = claim(ix, p, pos);
        size_t end;
        if (s && (type == SEC_ACLE_TYPE_USER || type == SEC_ACLE_TYPE_GROUP)) {
            s->slot0 = static_cast<uint32_t>(nslots);
            s->nslots = static_cast<uint32_t>(table_size(count));
            nslots += s->nslots;
            end = fill_entries(p, len, first, count, ix->slots + s->slot0, s->nslots, ix->seed, c);
        } else {
            end = check_entries(p, len, first, count, acl__type_has_id(type), c);
        }
        // Each sub-ACL but the last begins where the entries before it end.
        if (!end || (k + 1 < nsub && end != pos + acl__load_le32(p + pos))) return false;
        pos = end;
    }
    c.upto(pos);
    return true;
}

// The refusal of a buffer that broke a rule: validation's own record.
int32_t refuse(sec_acl_buffer_t acl) { return sec_convert_acl_to_host(1, acl); }

// A block of n bytes could not be had before the walk that checks the
// entries: a buffer that breaks a rule is still refused as validation
// refuses it, whatever memory there is.
int32_t no_memory(sec_acl_buffer_t acl, size_t n) {
    if (int32_t rc = refuse(acl)) return rc;
    return acl__no_memory(kCreate, n);
}

int32_t create(sec_acl_buffer_t acl, sec_acl_index_t *index) {
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, kCreate, 1, 0);
    if (!index) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, kCreate, 2, 0);
    *index = nullptr;
    const auto *p = static_cast<const unsigned char *>(acl->value);
    if (!p || acl->length < ACL_HDR_SIZE || p[0] != ACL_BUF_TYPE || p[1] != ACL_BUF_VERSION) return refuse(acl);
    // Evaluation refuses a buffer in the other byte order; so does the
    // index, rather than answer for bytes no evaluation would accept.
    if (p[2] != ACL_BUF_HOST_ORDER) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_BYTE_ORDER);
    const size_t len = static_cast<size_t>(acl->length);
    size_t nslots;
    if (!headers_ok(p, len, &nslots)) return refuse(acl);

    const unsigned nsub = acl__load_le16(p + 3);
    size_t nmech = 2;
    while (nmech < 2 * size_t{nsub}) nmech *= 2;
    const size_t subs_at = sizeof(sec_acl_index_s), mechs_at = subs_at + nsub * sizeof(sub_info),
                 slots_at = mechs_at + nmech * sizeof(mech_slot), size = slots_at + nslots * sizeof(id_slot);
    static_assert(sizeof(sec_acl_index_s) % alignof(sub_info) == 0 && sizeof(sub_info) % alignof(mech_slot) == 0 &&
                  sizeof(mech_slot) % alignof(id_slot) == 0);
    auto *block = static_cast<unsigned char *>(acl__calloc(size, 1));
    if (!block) return no_memory(acl, size);
    // Fresh pages would be much of the creation of a large index: fewer,
    // larger ones where the blocks allow.
    acl__advise_large(block + slots_at, nslots * sizeof(id_slot));
    auto *ix = reinterpret_cast<sec_acl_index_s *>(block);
    ix->subs = reinterpret_cast<sub_info *>(block + subs_at);
    ix->mechs = reinterpret_cast<mech_slot *>(block + mechs_at);
    ix->slots = reinterpret_cast<id_slot *>(block + slots_at);
    ix->mech_mask = static_cast<uint32_t>(nmech - 1);
    ix->seed = process_seed();
    if (!(ix->bytes = static_cast<unsigned char *>(acl__malloc(len)))) {
        release(ix);
        return no_memory(acl, len);
    }
    acl__advise_large(ix->bytes, len);
    if (!build(ix, p, len)) {
        release(ix);
        return refuse(acl);
    }
    *index = ix;
    return 0;
}

int32_t no_entry(unsigned type, const char *mech, const char *id) {
    return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::NO_MATCH, type, mech ? mech : "", id ? id : "");
}

// The first entry of `id` in a user or group sub-ACL, when the walk reaches
// it; null otherwise.
const unsigned char *probe(const sec_acl_index_s *ix, const sub_info &s, const char *id, size_t len) {
    const uint64_t h = text_hash(head_of(id, len), id, len, ix->seed);
    const id_slot *t = ix->slots + s.slot0;
    for (uint32_t i = slot_of(h, s.nslots);; i = i + 1 == s.nslots ? 0 : i + 1) {
        const id_slot &slot = t[i];
        if (!slot.off) return nullptr;
        if (!same_key(slot.key, h)) continue;
        const unsigned char *e = ix->bytes + slot.off;
        if (zo::casecmp_len(id, len, reinterpret_cast<const char *>(e + ACL_ENTRY_HDR_SIZE),
                            acl__load_le16(e + 5) - 1u) == 0)
            return (slot.key & kReached) ? e : nullptr;
    }
}

int32_t single(const sec_acl_index_s *ix, unsigned char type, const char *mech, const char *zmech,
               const char *id, uint32_t *perm) {
    static const char *const kName = "sec_index_single_acle_perm";
    if (!ix) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, kName, 1, 0);
    if (!perm) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, kName, 6, 0);
    const unsigned acletype = type & 0x1fu;
    if (acletype != SEC_ACLE_TYPE_UNAUTHENTICATED && acletype != SEC_ACLE_TYPE_ANYOTHER &&
        acletype != SEC_ACLE_TYPE_USER && acletype != SEC_ACLE_TYPE_EXPANDED)
        return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_EVAL_TYPE, type);
    const bool named = acl__type_has_mech(acletype);
    if (named && (!mech || !*mech)) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::MECH_REQUIRED);
    if (named && (!id || !*id)) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::ID_REQUIRED);

    *perm = 0;
    const sub_info *s = find_sub(ix, acletype, zmech ? zmech : mech);
    if (!s) return no_entry(type, mech, nullptr);
    const unsigned char *e = ix->bytes + s->first;
    if (!named) {
        if (s->count == 0) return no_entry(type, mech, nullptr);
        *perm = acl__load_le32(e + 1);
        return 0;
    }

    const sec_acl_id_handler handler = acl__eval_handler(acletype, type, mech);
    // Expanded identities are only ever matched by their mechanism's handler.
    if (acletype == SEC_ACLE_TYPE_EXPANDED && !handler) return no_entry(type, mech, id);
    if (!handler) {
        const unsigned char *hit = probe(ix, *s, id, std::strlen(id));
        if (!hit) return no_entry(type, mech, id);
        *perm = acl__load_le32(hit + 1);
        return 0;
    }
    // A handler sees every entry the walk shows it, in the same order.
    const bool ordered = acletype == SEC_ACLE_TYPE_USER;
    for (uint32_t k = 0; k < s->count; ++k) {
        const int32_t c = handler(id, reinterpret_cast<const char *>(e + ACL_ENTRY_HDR_SIZE));
        if (c == 0) {
            acl::clear_error();
            *perm = acl__load_le32(e + 1);
            return 0;
        }
        if (c < 0 && ordered) break;
        e += ACL_ENTRY_HDR_SIZE + acl__load_le16(e + 5);
    }
    return no_entry(type, mech, id);
}

int32_t groups_perm(const sec_acl_index_s *ix, int32_t count, sec_buffer_t groups, uint32_t *perm) {
    static const char *const kName = "sec_index_group_acles_perm";
    if (!ix) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, kName, 1, 0);
    if (count != 0 && !groups) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, kName, 3, 0);
    if (!perm) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, kName, 4, 0);
    for (int32_t g = 0; g < count; ++g)
        if (!groups[g].value) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, kName, 3, 0);

    *perm = 0;
    if (count == 0) return 0;
    const sub_info *s = find_sub(ix, SEC_ACLE_TYPE_GROUP, nullptr);
    if (!s) return no_entry(SEC_ACLE_TYPE_GROUP, nullptr, nullptr);
    uint32_t result = 0;
    bool matched = false;
    for (int32_t g = 0; g < count; ++g) {
        const char *name = static_cast<const char *>(groups[g].value);
        if (const unsigned char *hit = probe(ix, *s, name, std::strlen(name))) {
            result |= acl__load_le32(hit + 1);
            matched = true;
        }
    }
    if (!matched) return no_entry(SEC_ACLE_TYPE_GROUP, nullptr, nullptr);
    *perm = result;
    return 0;
}

}  // namespace

int32_t sec_create_acl_index(sec_acl_buffer_t acl, sec_acl_index_t *index) {
    acl::clear_error();
    return create(acl, index);
}

int32_t sec_index_single_acle_perm(sec_acl_index_t index, unsigned char type, const char *mech,
                                   const char *zmech, const char *id, uint32_t *perm) {
    acl::clear_error();
    acl__state_ensure_init();
    return single(index, type, mech, zmech, id, perm);
}

int32_t sec_index_group_acles_perm(sec_acl_index_t index, int32_t count, sec_buffer_t groups,
                                   uint32_t *perm) {
    acl::clear_error();
    acl__state_ensure_init();
    return groups_perm(index, count, groups, perm);
}

void sec_release_acl_index(sec_acl_index_t index) { release(index); }
