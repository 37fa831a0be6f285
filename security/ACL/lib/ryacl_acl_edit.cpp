// Editing a compiled ACL in place: adding and deleting one entry.
//
// The general road reads the one sub-ACL concerned into a tree, edits the
// tree, serialises it again and splices it into the caller's block.  A user
// or group sub-ACL that is well formed (entries exactly filling its length,
// identifiers strictly ascending) is edited directly on the bytes instead:
// one pass finds the place, one move opens or closes the gap.  The result is
// byte for byte what the tree road gives; whenever the bytes could make the
// two differ (duplicates, disorder, a refused duplicate, a missing entry)
// the tree road is taken, so its messages stay the only ones.
//
// The caller's buffer may not have been validated: the sub-ACL found must
// hold its header, and it is read within its room (the cursor's header
// says what the last sub-ACL's room is and what an edit replaces).
#include <cstdlib>
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_edit.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_tree.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

std::atomic<bool> acl__edit_direct_enabled{true};

namespace {

using acl::trace::str;
using acl::trace::strn;
using acl::trace::val;

constexpr size_t kMaxLength = INT32_MAX;

// The entry as the tree should see it: for types without a mechanism or an
// identifier those fields are never examined, so they are not copied either
// (the caller's may be garbage).  0, or 103/104 recorded.
int32_t take_entry(const sec_acle_desc *acle, sec_acle_desc *e) {
    std::memset(e, 0, sizeof *e);
    const unsigned type = acle->type;
    if (!acl__valid_type(type)) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::BAD_ACLE_TYPE, type);
    e->type = acle->type;
    e->perm = acle->perm;
    if (acl__type_has_mech(type)) {
        // An unterminated mechanism field is no mechanism.
        size_t mlen = strnlen(acle->mech, sizeof acle->mech);
        if (mlen == 0 || mlen == sizeof acle->mech || !acle->id)
            return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_TYPE_NEEDS_MECH_OR_ID, type);
        std::memcpy(e->mech, acle->mech, mlen);
    }
    if (type == SEC_ACLE_TYPE_GROUP && !acle->id) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_TYPE_NEEDS_MECH_OR_ID, type);
    if (acl__type_has_id(type)) e->id = acle->id;
    return 0;
}

// Header checks of an existing buffer.  A block shorter than the header is
// not read.
int32_t check_header(const sec_acl_buffer_desc *acl) {
    if (acl->length <= 0 || !acl->value) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_ACL);
    if (acl->length < ACL_HDR_SIZE)
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_TOO_SHORT, acl->length, ACL_LOC_ACL);
    const auto *p = static_cast<const unsigned char *>(acl->value);
    if (p[0] != ACL_BUF_TYPE) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_BUFFER_TYPE);
    if (p[1] != ACL_BUF_VERSION) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_BUFFER_VERSION);
    if (p[2] != ACL_BUF_HOST_ORDER) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_BYTE_ORDER);
    return 0;
}

// The entry's sub-ACL as the search found it, if it did.  Its header must
// lie in its room (97 otherwise).
struct located {
    bool found = false;
    acl__subacl s;
};
int32_t locate(const sec_acl_buffer_desc *acl, const sec_acle_desc *e, located *where) {
    *where = located{};
    where->found = acl__find_subacl(acl, e->type, e->mech, &where->s);
    if (where->found && !where->s.header_fits()) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
    return 0;
}

// The bytes an edit replaces: a sub-ACL's length, but the last one's
// through whichever ends later, its length or its entries (`used` bytes).
size_t extent(const acl__subacl &s, size_t used) { return s.last && used > s.length ? used : s.length; }

// ---- Direct edits of a sorted sub-ACL --------------------------------------

// One pass over a user or group sub-ACL.  ok is false when the sub-ACL is
// not in the form the tree road would write back unchanged.  at is the
// offset (in the block) of the first entry not ordering before id, match
// tells whether it is id's entry, and its size.
struct scan_result {
    bool ok = false;
    bool match = false;
    size_t at = 0;
    size_t size = 0;
    uint32_t count = 0;
};
scan_result scan_sorted(const unsigned char *base, const acl__subacl &s, const char *id) {
    scan_result r;
    const unsigned char *sub = base + s.off;
    const unsigned mlen = s.mechlen;
    if (s.type == SEC_ACLE_TYPE_USER) {
        if (mlen < 2 || mlen > 17 ||
            strnlen(reinterpret_cast<const char *>(sub + ACL_SUBACL_HDR_SIZE), mlen) + 1 != mlen)
            return r;
    } else if (s.type != SEC_ACLE_TYPE_GROUP || mlen != 0) {
        return r;
    }
    const size_t idtextlen = std::strlen(id);
    const char *prev = nullptr;
    size_t prevlen = 0;
    bool placed = false;
    acl__entry_cursor<> entries(base, s, s.end());
    acl__entry e;
    int n;
    while ((n = entries.next(&e)) == 1) {
        const size_t idlen = e.idlen;
        if (e.version != 1 || idlen == 0 || strnlen(e.id, idlen) + 1 != idlen) return r;
        if (prev && zo::casecmp_len(prev, prevlen, e.id, idlen - 1) >= 0) return r;
        if (!placed) {
            int c = zo::casecmp_len(id, idtextlen, e.id, idlen - 1);
            if (c <= 0) {
                placed = true;
                r.match = c == 0;
                r.at = e.off;
                r.size = ACL_ENTRY_HDR_SIZE + idlen;
            }
        }
        prev = e.id;
        prevlen = idlen - 1;
    }
    // The entries must fill the sub-ACL's length exactly.
    const size_t end = s.off + s.length;
    if (n < 0 || entries.pos() != end) return r;
    if (!placed) r.at = end;
    r.count = s.count;
    r.ok = true;
    return r;
}

// -1: not for the direct road.
int32_t direct_add(sec_boolean_t noupdate, const sec_acle_desc *e, sec_acl_buffer_t acl,
                   const acl__subacl &where) {
    auto *base = static_cast<unsigned char *>(acl->value);
    const scan_result s = scan_sorted(base, where, e->id);
    if (!s.ok) return -1;
    if (s.match) {
        if (noupdate) return -1;  // the tree refuses it with its own message
        acl__store_le32(base + s.at + 1, e->perm);
        return 0;
    }
    const size_t idlen = std::strlen(e->id) + 1;
    const size_t grow = ACL_ENTRY_HDR_SIZE + idlen;
    const size_t total = static_cast<size_t>(acl->length);
    if (idlen - 1 > ACL_MAX_IDLEN || s.count == UINT32_MAX || grow > kMaxLength - total) return -1;
    const size_t newtotal = total + grow;
    auto *grown = static_cast<unsigned char *>(acl__realloc(base, newtotal));
    if (!grown) return acl__no_memory("sec_add_acle_to_acl", newtotal);
    acl->value = base = grown;
    std::memmove(base + s.at + grow, base + s.at, total - s.at);
    unsigned char *ent = base + s.at;
    ent[0] = 1;
    acl__store_le32(ent + 1, e->perm);
    acl__store_le16(ent + 5, static_cast<uint16_t>(idlen));
    std::memcpy(ent + ACL_ENTRY_HDR_SIZE, e->id, idlen);
    unsigned char *sub = base + where.off;
    acl__store_le32(sub, where.length + static_cast<uint32_t>(grow));
    acl__store_le32(sub + 5, s.count + 1);
    acl->length = static_cast<int32_t>(newtotal);
    return 0;
}

// Shrinks the block to `newtotal` after the bytes were moved; when that
// fails the larger block is kept, already describing the edited ACL.
int32_t shrink(sec_acl_buffer_t acl, size_t newtotal) {
    acl->length = static_cast<int32_t>(newtotal);
    void *smaller = acl__realloc(acl->value, newtotal);
    if (!smaller) return acl__no_memory("sec_del_acle_from_acl", newtotal);
    acl->value = smaller;
    return 0;
}

// Remove the `len` bytes of the sub-ACL at `off`.
int32_t drop_subacl(sec_acl_buffer_t acl, size_t off, size_t len) {
    auto *base = static_cast<unsigned char *>(acl->value);
    const size_t total = static_cast<size_t>(acl->length);
    std::memmove(base + off, base + off + len, total - off - len);
    acl__store_le16(base + 3, static_cast<uint16_t>(acl__load_le16(base + 3) - 1));
    return shrink(acl, total - len);
}

int32_t direct_del(const sec_acle_desc *e, sec_acl_buffer_t acl, const acl__subacl &where) {
    auto *base = static_cast<unsigned char *>(acl->value);
    const scan_result s = scan_sorted(base, where, e->id);
    if (!s.ok || !s.match) return -1;  // the tree reports what is missing
    if (s.count == 1) return drop_subacl(acl, where.off, where.length);
    const size_t total = static_cast<size_t>(acl->length);
    std::memmove(base + s.at, base + s.at + s.size, total - s.at - s.size);
    unsigned char *sub = base + where.off;
    acl__store_le32(sub, where.length - static_cast<uint32_t>(s.size));
    acl__store_le32(sub + 5, s.count - 1);
    return shrink(acl, total - s.size);
}

// ---- The tree road ------------------------------------------------------------

// Put `fresh` in place of the `old` bytes at `at`.  A growing block is
// reallocated before the first byte changes, so a failure leaves the ACL as
// it was.  `who` names the operation in a memory failure; a shrinking
// delete then gives the block back as well.
int32_t splice(sec_acl_buffer_t acl, size_t at, size_t old, const unsigned char *fresh, size_t freshlen,
               const char *who, bool give_back) {
    auto *base = static_cast<unsigned char *>(acl->value);
    const size_t total = static_cast<size_t>(acl->length);
    if (freshlen > old) {
        const size_t grow = freshlen - old;
        if (grow > kMaxLength - total)
            return acl__no_memory(who, kMaxLength);
        auto *grown = static_cast<unsigned char *>(acl__realloc(base, total + grow));
        if (!grown) return acl__no_memory(who, total + grow);
        acl->value = base = grown;
    }
    std::memmove(base + at + freshlen, base + at + old, total - at - old);
    std::memcpy(base + at, fresh, freshlen);
    const size_t newtotal = total - old + freshlen;
    // A shorter add (a sub-ACL from outside that held duplicates) keeps its
    // block; a delete gives the spare bytes back.
    if (give_back && newtotal < total) return shrink(acl, newtotal);
    acl->length = static_cast<int32_t>(newtotal);
    return 0;
}

// Append `fresh` as the new last sub-ACL: right after the entries of the
// present last one, whose length is made exact, since it will no longer be
// the last and validation will hold it to its length.  Bytes that lay
// after those entries follow the new sub-ACL, outside every sub-ACL.
int32_t append(sec_acl_buffer_t acl, const unsigned char *fresh, size_t freshlen) {
    const auto *base = static_cast<const unsigned char *>(acl->value);
    const size_t total = static_cast<size_t>(acl->length);
    const unsigned nsub = acl__load_le16(base + 3);
    // The header counts sub-ACLs in 16 bits: a 65536th cannot be recorded,
    // so the ACL is refused as unable to take it.
    if (nsub == ACL_MAX_SUBACLS) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_ACL);
    acl__subacl_cursor<> subs(base, total);
    acl__subacl last;
    int r;
    while ((r = subs.next(&last)) == 1) {
    }
    size_t at = ACL_HDR_SIZE;
    if (r == 0 && nsub) {
        acl__entry_cursor<> entries(base, last, last.end());
        acl__entry e;
        int n = last.header_fits() ? 1 : -1;
        while (n == 1) n = entries.next(&e);
        r = n;
        at = entries.pos();
    }
    if (r < 0) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
    if (int32_t rc = splice(acl, at, 0, fresh, freshlen, "sec_add_acle_to_acl", false)) return rc;
    auto *grown = static_cast<unsigned char *>(acl->value);
    if (nsub) acl__store_le32(grown + last.off, static_cast<uint32_t>(at - last.off));
    acl__store_le16(grown + 3, static_cast<uint16_t>(nsub + 1));
    return 0;
}

int32_t read_subacl(const sec_acl_buffer_desc *acl, const located &where, sec_acltree_t *tree, size_t *used) {
    *tree = nullptr;
    *used = 0;
    if (!where.found) return 0;
    return sec__subacl_to_acltree(static_cast<const unsigned char *>(acl->value) + where.s.off, where.s.room(),
                                  tree, used);
}

int32_t tree_add(sec_boolean_t noupdate, const sec_acle_desc *e, sec_acl_buffer_t acl,
                 const located &where) {
    sec_acltree_t tree = nullptr;
    size_t used = 0;
    int32_t rc = read_subacl(acl, where, &tree, &used);
    // A sub-ACL found without entries gives no tree to carry its mechanism:
    // the entry comes in under the sub-ACL's spelling, as into one with
    // entries, not under the caller's.  Reading it checked that spelling.
    sec_acle_desc spelt = *e;
    if (!rc && where.found && !tree && acl__type_has_mech(e->type)) {
        std::memset(spelt.mech, 0, sizeof spelt.mech);
        std::memcpy(spelt.mech, static_cast<const unsigned char *>(acl->value) + where.s.off + ACL_SUBACL_HDR_SIZE,
                    where.s.mechlen);
    }
    if (!rc) rc = sec__add_acle_to_tree(noupdate, &spelt, &tree);
    unsigned char *fresh = nullptr;
    size_t freshlen = 0;
    if (!rc) {
        rc = sec__acltree_to_subacl(tree, &fresh, &freshlen);
        if (!rc && !fresh) rc = acl::set_error(ACL_RC_INTERNAL, acl::msg::INTERNAL, ACL_LOC_ACL, rc);
    }
    sec__free_acltree(tree);
    if (!rc)
        rc = where.found ? splice(acl, where.s.off, extent(where.s, used), fresh, freshlen, "sec_add_acle_to_acl", false)
                         : append(acl, fresh, freshlen);
    std::free(fresh);
    return rc;
}

int32_t tree_del(const sec_acle_desc *e, sec_acl_buffer_t acl, const located &where) {
    sec_acltree_t tree = nullptr;
    size_t used = 0;
    int32_t rc = read_subacl(acl, where, &tree, &used);
    if (!rc && acl__tree_count(tree) == 0)
        rc = acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_NOT_IN_ACL, e->type, e->mech, e->id ? e->id : "");
    if (!rc) rc = sec__del_acle_from_tree(e, tree);
    unsigned char *fresh = nullptr;
    size_t freshlen = 0;
    if (!rc) rc = sec__acltree_to_subacl(tree, &fresh, &freshlen);
    sec__free_acltree(tree);
    if (!rc) {
        const size_t old = extent(where.s, used);
        if (!fresh) rc = drop_subacl(acl, where.s.off, old);
        else rc = splice(acl, where.s.off, old, fresh, freshlen, "sec_del_acle_from_acl", true);
    }
    std::free(fresh);
    return rc;
}

bool direct_road(unsigned type) { return type == SEC_ACLE_TYPE_USER || type == SEC_ACLE_TYPE_GROUP; }

int32_t add_entry(sec_boolean_t noupdate, sec_acle_t acle, sec_acl_buffer_t acl) {
    if (!acle) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_add_acle_to_acl", 1, 0);
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_add_acle_to_acl", 2, 0);
    sec_acle_desc e;
    if (int32_t rc = take_entry(acle, &e)) return rc;

    bool allocated = false;
    if (acl->length == 0 && !acl->value) {
        auto *p = static_cast<unsigned char *>(acl__malloc(ACL_HDR_SIZE));
        if (!p) return acl__no_memory("sec_add_acle_to_acl", ACL_HDR_SIZE);
        p[0] = ACL_BUF_TYPE;
        p[1] = ACL_BUF_VERSION;
        p[2] = ACL_BUF_HOST_ORDER;
        acl__store_le16(p + 3, 0);
        acl->value = p;
        acl->length = ACL_HDR_SIZE;
        allocated = true;
    } else if (int32_t rc = check_header(acl)) {
        return rc;
    }

    located where;
    int32_t rc = locate(acl, &e, &where);
    if (!rc) {
        rc = -1;
        if (where.found && direct_road(e.type) && acl__edit_direct_enabled.load(std::memory_order_relaxed))
            rc = direct_add(noupdate, &e, acl, where.s);
        if (rc == -1) rc = tree_add(noupdate, &e, acl, where);
    }
    if (rc && allocated) {
        std::free(acl->value);
        acl->value = nullptr;
        acl->length = 0;
    }
    return rc;
}

int32_t del_entry(sec_acle_t acle, sec_acl_buffer_t acl) {
    if (!acle) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_del_acle_from_acl", 1, 0);
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_del_acle_from_acl", 2, 0);
    sec_acle_desc e;
    if (int32_t rc = take_entry(acle, &e)) return rc;
    if (int32_t rc = check_header(acl)) return rc;
    located where;
    if (int32_t rc = locate(acl, &e, &where)) return rc;
    if (!where.found)
        return acl::set_error(ACL_RC_NO_MATCH, acl::msg::ACLE_NOT_IN_ACL, e.type, e.mech, e.id ? e.id : "");
    int32_t rc = -1;
    if (direct_road(e.type) && acl__edit_direct_enabled.load(std::memory_order_relaxed))
        rc = direct_del(&e, acl, where.s);
    if (rc == -1) rc = tree_del(&e, acl, where);
    return rc;
}

void trace_entry(uint32_t id, uint32_t data_id, const sec_acle_desc *acle, const sec_acl_buffer_desc *acl) {
    acl::trace::api_entry(
        id, data_id,
        {val(acle), val(acle ? acle->type : 0), val(acle ? acle->perm : 0u),
         strn(acle ? acle->mech : nullptr, sizeof acle->mech),
         // Types without an identifier may carry any pointer there.
         str(acle && acl__type_has_id(acle->type) ? acle->id : nullptr),
         val(acl), val(acl ? acl->length : 0), val(acl ? acl->value : nullptr)});
}

}  // namespace

int32_t sec__add_acle_to_acl(sec_boolean_t noupdate, sec_acle_t acle, sec_acl_buffer_t acl) {
    trace_entry(60, 62, acle, acl);
    acl::clear_error();
    int32_t rc = add_entry(noupdate, acle, acl);
    acl::trace::api_exit(63, 64, rc);
    return rc;
}

int32_t sec_add_acle_to_acl(sec_acle_t acle, sec_acl_buffer_t acl) {
    return sec__add_acle_to_acl(0, acle, acl);
}

int32_t sec_add_acle_to_acl2(sec_acle_t acle, sec_acl_buffer_t acl) {
    return sec__add_acle_to_acl(1, acle, acl);
}

int32_t sec_del_acle_from_acl(sec_acle_t acle, sec_acl_buffer_t acl) {
    trace_entry(65, 67, acle, acl);
    acl::clear_error();
    int32_t rc = del_entry(acle, acl);
    acl::trace::api_exit(68, 69, rc);
    return rc;
}
