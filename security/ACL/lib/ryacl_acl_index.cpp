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

#include <cstring>

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

// The first 16 bytes of an identifier as the comparison sees them: ASCII
// capitals folded, bytes past its end zero.  Read whole words from a text
// with at least 16 readable bytes (the index's copy is padded for this), or
// from a stack copy of a caller's shorter text.
struct head16 {
    uint64_t a, b;
};
inline uint64_t low_bytes(uint64_t w, size_t n) { return n >= 8 ? w : w & ((uint64_t{1} << (8 * n)) - 1); }
inline head16 head_padded(const char *p, size_t len) {
    return {zo::fold8(low_bytes(zo::load8(p), len)), zo::fold8(low_bytes(zo::load8(p + 8), len > 8 ? len - 8 : 0))};
}
inline head16 head_of(const char *p, size_t len) {
    if (len >= 16) return head_padded(p, len);
    char buf[16] = {};
    std::memcpy(buf, p, len);
    return head_padded(buf, len);
}

// Hash of an identifier as the comparison sees it, so identifiers that
// compare equal hash equal.  Past 16 bytes, 8 at a time.
// `padded`: whole words may be read past the end, as in the copy.
template <bool padded>
uint64_t text_hash(const head16 &k, const char *p, size_t len, uint64_t seed) {
    // Both halves keyed: no chosen text can zero a factor for every seed.
    uint64_t h = mum(k.a ^ seed, k.b ^ seed ^ kMixA);
    if (len <= 16) return h;
    for (size_t i = 16; i < len; i += 8) {
        uint64_t w = 0;
        if constexpr (padded) w = low_bytes(zo::load8(p + i), len - i);
        else std::memcpy(&w, p + i, len - i < 8 ? len - i : 8);
        h = mum(h ^ zo::fold8(w), kMixB);
    }
    return mum(h, kMixC ^ len);
}

// Order of two identifiers as the comparison gives it, from their heads
// where those differ.
inline int order(const head16 &x, const char *p, size_t plen, const head16 &y, const char *q, size_t qlen) {
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

inline uint32_t slot_of(uint64_t h, uint32_t n) {
    return static_cast<uint32_t>((static_cast<uint64_t>(static_cast<uint32_t>(h >> 32)) * n) >> 32);
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

struct sec_acl_index_s {
    unsigned char *bytes;  // the copy of the compiled ACL
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

// Zeroed blocks, but for the copy, which is written over at once.
void *index_alloc(size_t count, size_t size, int32_t *rc, bool zeroed = true) {
    void *p = zeroed ? acl__calloc(count, size) : acl__malloc(count * size);
    if (!p) *rc = acl__no_memory(kCreate, static_cast<int32_t>(count * size));
    return p;
}

// Zero bytes after the copy: whole-word reads of its last identifier stay
// inside the block.
constexpr size_t kPad = 16;

void release(sec_acl_index_s *ix) {
    if (!ix) return;
    std::free(ix->bytes);
    std::free(ix->subs);
    std::free(ix->mechs);
    std::free(ix->slots);
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

// Record the sub-ACLs the walk can find, in a buffer that validated: the
// first of each type (and mechanism), the last sub-ACL whatever its length
// field says.  Returns the identifier slots needed.
size_t map_subs(sec_acl_index_s *ix) {
    const unsigned char *p = ix->bytes;
    const unsigned nsub = acl__load_le16(p + 3);
    size_t pos = ACL_HDR_SIZE, nslots = 0;
    for (unsigned k = 0; k < nsub; ++k) {
        const unsigned type = p[pos + 4];
        const size_t mlen = p[pos + 9];
        const bool by_mech = acl__type_has_mech(type);
        uint32_t *owner = nullptr;
        mech_slot *ms = nullptr;
        if (!by_mech) {
            owner = &ix->by_type[plain_slot(type)];
            if (*owner) owner = nullptr;
        } else {
            uint64_t w[2] = {};
            mech_key(reinterpret_cast<const char *>(p + pos + ACL_SUBACL_HDR_SIZE), mlen - 1, w);
            uint32_t i = static_cast<uint32_t>(mech_hash(w, type, ix->seed)) & ix->mech_mask;
            while (ix->mechs[i].sub && !(ix->mechs[i].type == type && ix->mechs[i].w[0] == w[0] &&
                                         ix->mechs[i].w[1] == w[1]))
                i = (i + 1) & ix->mech_mask;
            if (!ix->mechs[i].sub) {
                ms = &ix->mechs[i];
                ms->w[0] = w[0];
                ms->w[1] = w[1];
                ms->type = type;
                owner = &ms->sub;
            }
        }
        if (owner) {
            sub_info &s = ix->subs[ix->nsubs];
            *owner = ++ix->nsubs;
            s.first = static_cast<uint32_t>(pos + ACL_SUBACL_HDR_SIZE + mlen);
            s.count = acl__load_le32(p + pos + 5);
            if (type == SEC_ACLE_TYPE_USER || type == SEC_ACLE_TYPE_GROUP) {
                // Load at most two thirds: a miss ends within a few slots.
                s.slot0 = static_cast<uint32_t>(nslots);
                s.nslots = s.count + s.count / 2 + 1;
                nslots += s.nslots;
            }
        }
        pos += acl__load_le32(p + pos);
    }
    return nslots;
}

// Insert one entry unless an earlier entry of its identifier is there.
inline void insert(const sec_acl_index_s *ix, id_slot *t, uint32_t n, uint32_t i, uint64_t h, uint32_t key,
                   uint32_t off, const char *id, size_t len) {
    for (;; i = i + 1 == n ? 0 : i + 1) {
        id_slot &slot = t[i];
        if (!slot.off) {
            slot.key = key;
            slot.off = off;
            return;
        }
        // A later entry of the same identifier is never the walk's answer.
        if (same_key(slot.key, h)) {
            const unsigned char *o = ix->bytes + slot.off;
            if (zo::casecmp_len(id, len, reinterpret_cast<const char *>(o + ACL_ENTRY_HDR_SIZE),
                                acl__load_le16(o + 5) - 1u) == 0)
                return;
        }
    }
}

// Fill one sub-ACL's identifier table from its entries, in order.  Entries
// go in by batches whose slots are fetched ahead, so the table's cache
// misses overlap instead of following one another.
void fill_table(const sec_acl_index_s *ix, const sub_info &s) {
    constexpr uint32_t kBatch = 16;
    struct pending {
        uint64_t h;
        uint32_t key, off, slot;
        const char *id;
        size_t len;
    } batch[kBatch];
    id_slot *t = ix->slots + s.slot0;
    const unsigned char *e = ix->bytes + s.first;
    head16 top{};  // the highest identifier so far
    const char *topid = nullptr;
    size_t toplen = 0;
    for (uint32_t done = 0; done < s.count;) {
        const uint32_t n = s.count - done < kBatch ? s.count - done : kBatch;
        for (uint32_t k = 0; k < n; ++k) {
            const size_t idlen = acl__load_le16(e + 5);
            const char *id = reinterpret_cast<const char *>(e + ACL_ENTRY_HDR_SIZE);
            const size_t len = idlen - 1;
            const head16 head = head_padded(id, len);
            const bool reached = !topid || order(head, id, len, top, topid, toplen) > 0;
            if (reached) top = head, topid = id, toplen = len;
            const uint64_t h = text_hash<true>(head, id, len, ix->seed);
            const uint32_t slot = slot_of(h, s.nslots);
            __builtin_prefetch(t + slot, 1);
            batch[k] = {h, (static_cast<uint32_t>(h) & ~kReached) | (reached ? kReached : 0),
                        static_cast<uint32_t>(e - ix->bytes), slot, id, len};
            e += ACL_ENTRY_HDR_SIZE + idlen;
        }
        for (uint32_t k = 0; k < n; ++k) {
            const pending &b = batch[k];
            insert(ix, t, s.nslots, b.slot, b.h, b.key, b.off, b.id, b.len);
        }
        done += n;
    }
}

int32_t create(sec_acl_buffer_t acl, sec_acl_index_t *index) {
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, kCreate, 1, 0);
    if (!index) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, kCreate, 2, 0);
    *index = nullptr;
    const auto *p = static_cast<const unsigned char *>(acl->value);
    // Evaluation refuses a buffer in the other byte order; so does the
    // index, rather than answer for bytes no evaluation would accept.
    if (acl->length >= ACL_HDR_SIZE && p && p[0] == ACL_BUF_TYPE && p[1] == ACL_BUF_VERSION &&
        p[2] != ACL_BUF_HOST_ORDER)
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_BYTE_ORDER);
    // Every other refusal is the conversion's own record, word for word; on
    // a host-order buffer it only reads.
    if (int32_t rc = sec_convert_acl_to_host(1, acl)) return rc;

    const size_t len = static_cast<size_t>(acl->length);
    const unsigned nsub = acl__load_le16(p + 3);
    size_t nmech = 2;
    while (nmech < 2 * size_t{nsub}) nmech *= 2;
    int32_t rc = 0;
    auto *ix = static_cast<sec_acl_index_s *>(index_alloc(1, sizeof(sec_acl_index_s), &rc));
    if (!ix) return rc;
    ix->seed = process_seed();
    ix->mech_mask = static_cast<uint32_t>(nmech - 1);
    if ((ix->bytes = static_cast<unsigned char *>(index_alloc(len + kPad, 1, &rc, false))) &&
        (ix->subs = static_cast<sub_info *>(index_alloc(nsub ? nsub : 1, sizeof(sub_info), &rc))) &&
        (ix->mechs = static_cast<mech_slot *>(index_alloc(nmech, sizeof(mech_slot), &rc)))) {
        // Fresh pages are a third of the creation of a large index: fewer,
        // larger ones where the blocks allow.
        acl__advise_large(ix->bytes, len + kPad);
        std::memcpy(ix->bytes, p, len);
        std::memset(ix->bytes + len, 0, kPad);
        const size_t nslots = map_subs(ix);
        if ((ix->slots = static_cast<id_slot *>(index_alloc(nslots ? nslots : 1, sizeof(id_slot), &rc)))) {
            acl__advise_large(ix->slots, nslots * sizeof(id_slot));
            for (uint32_t s = 0; s < ix->nsubs; ++s)
                if (ix->subs[s].nslots) fill_table(ix, ix->subs[s]);
        }
    }
    if (rc) {
        release(ix);
        return rc;
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
    const uint64_t h = text_hash<false>(head_of(id, len), id, len, ix->seed);
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
