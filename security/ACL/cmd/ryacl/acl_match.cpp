// ryacl: matching the entries of two ACLs (see acl_match.h).
//
// Speed at a million entries a side is memory latency, not arithmetic: the
// table is probed at random.  So the hashes of a side are computed first, in
// file order, and each probe's slot is prefetched a few entries ahead; a
// slot holds 32 bits of the hash beside the entry, so an entry is only
// looked at when its key is almost surely the one sought.
#include "acl_match.h"

#include <algorithm>
#include <cstring>
#include <string>

#include "ry_zo_int.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_tree.h"
#include "ryacl_error.h"

namespace ryacl {

namespace {

constexpr uint64_t kMul = 0x9e3779b97f4a7c15ull;
// A slot: the hash's top 31 bits, a bit set once an OLD entry has been
// matched (so that a second NEW one finds it without reading old_match at
// random), then the entry's side << 31 | index, + 1.
constexpr unsigned kTagShift = 33;
constexpr uint64_t kMatched = uint64_t{1} << 32;

uint64_t mix(uint64_t h) {
    h ^= h >> 32;
    h *= 0xd6e8feb86659fd93ull;
    h ^= h >> 32;
    return h;
}

// Eight bytes of a mechanism field (zero-padded to 17), folded.
uint64_t mech_word(const char *mech, size_t at) { return zo::fold8(zo::load8(mech + at)); }

// Folded identifier, eight bytes at a time; never reads past its end.
uint64_t id_hash(const char *id, size_t n, uint64_t h) {
    size_t i = 0;
    for (; i + 8 <= n; i += 8) h = (h ^ zo::fold8(zo::load8(id + i))) * kMul + (h >> 29);
    uint64_t tail = 0;
    for (size_t k = 0; i + k < n; ++k) tail |= uint64_t{zo::fold(static_cast<unsigned char>(id[i + k]))} << (8 * k);
    return mix((h ^ tail ^ n) * kMul);
}

// How far ahead the three prefetch stages run: the slot, then the entry it
// names, then that entry's identifier.
constexpr size_t kSlotAhead = 24, kEntryAhead = 12, kIdAhead = 6;

// The library's own message for two entries found equal: add both to a
// fresh set of trees.
int32_t report_duplicate(const acl_item &first, const acl_item &dup) {
    acl__trees_s trees;
    int32_t rc = 0;
    for (const acl_item *e : {&first, &dup}) {
        sec_acle_desc d{};
        d.perm = e->perm;
        d.type = e->type;
        std::memcpy(d.mech, e->mech, sizeof d.mech);
        d.id = const_cast<char *>(e->id);
        if ((rc = sec__add_acle_to_trees(&d, &trees)) != 0) break;
    }
    acl__free_trees(&trees);
    // Equal here but not to the trees cannot happen; should it, the file
    // is still refused rather than compared wrongly.
    return rc ? rc
              : acl::set_error(ACL_RC_BAD_ACLE, acl::msg::DUPLICATE_ACLE, acl__type_letter(dup.type), dup.mech,
                               dup.id ? dup.id : "");
}

}  // namespace

entry_matcher::entry_matcher(const loaded_acl &o, const loaded_acl &n) : acl_{&o, &n} {
    size_t cap = 1024;
    while (cap < 2 * (o.items.size() + n.items.size())) cap *= 2;
    table_.assign(cap, 0);
    mask_ = cap - 1;
    old_match.assign(o.items.size(), kNone);
    new_done.assign(n.items.size(), false);
    old_changed.assign(o.items.size(), false);
}

// The entry named by the first slot of a hash's probe whose tag agrees (the
// one the probe will compare with), looking no further than the few slots
// that share the fetched line; null when none does.
const acl_item *entry_matcher::first_candidate(uint64_t h) const {
    for (uint64_t s = h & mask_, k = 0; k < 4; ++k, s = (s + 1) & mask_) {
        const uint64_t v = table_[s];
        if (v == 0) return nullptr;
        if (v >> kTagShift != h >> kTagShift) continue;
        const uint32_t ref = static_cast<uint32_t>(v) - 1;
        return &acl_[ref >> 31]->items[ref & 0x7fffffffu];
    }
    return nullptr;
}

bool entry_matcher::same(int sa, uint32_t a, int sb, uint32_t b) const {
    const acl_item &x = acl_[sa]->items[a], &y = acl_[sb]->items[b];
    return x.type == y.type && x.idlen == y.idlen && mech_word(x.mech, 0) == mech_word(y.mech, 0) &&
           mech_word(x.mech, 8) == mech_word(y.mech, 8) &&
           (x.idlen == 0 || zo::casecmp_len(x.id, x.idlen, y.id, y.idlen) == 0);
}

int32_t entry_matcher::add_side(int side) {
    const loaded_acl &acl = *acl_[side];
    const size_t n = acl.items.size();
    std::vector<uint64_t> hashes(n);
    for (size_t i = 0; i < n; ++i) {
        const acl_item &e = acl.items[i];
        const uint64_t seed = mix((mech_word(e.mech, 0) ^ e.type) * kMul ^ mech_word(e.mech, 8));
        hashes[i] = id_hash(e.id, e.idlen, seed);
    }
    for (size_t i = 0; i < n; ++i) {
        if (i + kSlotAhead < n) __builtin_prefetch(&table_[hashes[i + kSlotAhead] & mask_]);
        if (i + kEntryAhead < n) {
            if (const acl_item *e = first_candidate(hashes[i + kEntryAhead])) {
                // An item may straddle two lines; the comparison reads all of it.
                __builtin_prefetch(e);
                __builtin_prefetch(reinterpret_cast<const char *>(e + 1) - 1);
            }
        }
        if (i + kIdAhead < n) {
            if (const acl_item *e = first_candidate(hashes[i + kIdAhead])) __builtin_prefetch(e->id);
        }
        const uint64_t h = hashes[i];
        const uint64_t tag = h >> kTagShift;
        const uint32_t me = static_cast<uint32_t>(i);
        uint64_t s = h & mask_;
        for (;; s = (s + 1) & mask_) {
            const uint64_t v = table_[s];
            if (v == 0) {
                table_[s] = tag << kTagShift | ((uint64_t{static_cast<uint32_t>(side)} << 31 | me) + 1);
                break;
            }
            if (v >> kTagShift != tag) continue;
            const uint32_t ref = static_cast<uint32_t>(v) - 1;
            const int rs = static_cast<int>(ref >> 31);
            const uint32_t ri = ref & 0x7fffffffu;
            if (!same(rs, ri, side, me)) continue;
            if (rs == side || (side == 1 && (v & kMatched))) {
                // The key is already on this side.
                if (!acl.compiled) {
                    const acl_item &first = rs == side ? acl.items[ri] : acl.items[old_match[ri] - 1];
                    return report_duplicate(first, acl.items[me]);
                }
                if (side == 0) old_match[me] = kShadowed;
                else new_done[me] = true;
                break;
            }
            old_match[ri] = me + 1;
            old_changed[ri] = acl_[0]->items[ri].perm != acl.items[me].perm;
            table_[s] = v | kMatched;
            new_done[me] = true;
            break;
        }
    }
    return 0;
}

int32_t entry_matcher::run() {
    if (int32_t rc = add_side(0)) return rc;
    return add_side(1);
}

}  // namespace ryacl
