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
// lie inside the block, and its reading is bounded by its own length.
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

// Where the entry's sub-ACL lies: off == 0 when there is none.  The sub-ACL
// must cover its own header and end inside the block (97 otherwise).
struct located {
    size_t off = 0;
    size_t len = 0;
};
int32_t locate(const sec_acl_buffer_desc *acl, const sec_acle_desc *e, located *where) {
    unsigned char *sub = nullptr;
    sec__find_subacl(acl, e->type, e->mech, &sub);
    *where = located{};
    if (!sub) return 0;
    const auto *base = static_cast<const unsigned char *>(acl->value);
    const size_t total = static_cast<size_t>(acl->length);
    const size_t off = static_cast<size_t>(sub - base);
    if (off < ACL_HDR_SIZE || total - off < ACL_SUBACL_HDR_SIZE)
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
    const size_t len = acl__load_le32(sub);
    if (len > total - off || len < ACL_SUBACL_HDR_SIZE + size_t{sub[9]})
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
    *where = located{off, len};
    return 0;
}

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
scan_result scan_sorted(const unsigned char *base, const located &where, const char *id) {
    scan_result r;
    const unsigned char *sub = base + where.off;
    const unsigned type = sub[4];
    const unsigned mlen = sub[9];
    if (type == SEC_ACLE_TYPE_USER) {
        if (mlen < 2 || mlen > 17 ||
            strnlen(reinterpret_cast<const char *>(sub + ACL_SUBACL_HDR_SIZE), mlen) + 1 != mlen)
            return r;
    } else if (type != SEC_ACLE_TYPE_GROUP || mlen != 0) {
        return r;
    }
    const uint32_t count = acl__load_le32(sub + 5);
    const size_t end = where.len;
    size_t pos = ACL_SUBACL_HDR_SIZE + mlen;
    const size_t idtextlen = std::strlen(id);
    const char *prev = nullptr;
    size_t prevlen = 0;
    bool placed = false;
    for (uint32_t i = 0; i < count; ++i) {
        if (end - pos < ACL_ENTRY_HDR_SIZE || sub[pos] != 1) return r;
        const size_t idlen = acl__load_le16(sub + pos + 5);
        if (end - pos - ACL_ENTRY_HDR_SIZE < idlen || idlen == 0) return r;
        const char *eid = reinterpret_cast<const char *>(sub + pos + ACL_ENTRY_HDR_SIZE);
        if (strnlen(eid, idlen) + 1 != idlen) return r;
        if (prev && zo::casecmp_len(prev, prevlen, eid, idlen - 1) >= 0) return r;
        if (!placed) {
            int c = zo::casecmp_len(id, idtextlen, eid, idlen - 1);
            if (c <= 0) {
                placed = true;
                r.match = c == 0;
                r.at = where.off + pos;
                r.size = ACL_ENTRY_HDR_SIZE + idlen;
            }
        }
        prev = eid;
        prevlen = idlen - 1;
        pos += ACL_ENTRY_HDR_SIZE + idlen;
    }
    if (pos != end) return r;
    if (!placed) r.at = where.off + end;
    r.count = count;
    r.ok = true;
    return r;
}

// -1: not for the direct road.
int32_t direct_add(sec_boolean_t noupdate, const sec_acle_desc *e, sec_acl_buffer_t acl,
                   const located &where) {
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
    acl__store_le32(sub, static_cast<uint32_t>(where.len + grow));
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

int32_t drop_subacl(sec_acl_buffer_t acl, const located &where) {
    auto *base = static_cast<unsigned char *>(acl->value);
    const size_t total = static_cast<size_t>(acl->length);
    std::memmove(base + where.off, base + where.off + where.len, total - where.off - where.len);
    acl__store_le16(base + 3, static_cast<uint16_t>(acl__load_le16(base + 3) - 1));
    return shrink(acl, total - where.len);
}

int32_t direct_del(const sec_acle_desc *e, sec_acl_buffer_t acl, const located &where) {
    auto *base = static_cast<unsigned char *>(acl->value);
    const scan_result s = scan_sorted(base, where, e->id);
    if (!s.ok || !s.match) return -1;  // the tree reports what is missing
    if (s.count == 1) return drop_subacl(acl, where);
    const size_t total = static_cast<size_t>(acl->length);
    std::memmove(base + s.at, base + s.at + s.size, total - s.at - s.size);
    unsigned char *sub = base + where.off;
    acl__store_le32(sub, static_cast<uint32_t>(where.len - s.size));
    acl__store_le32(sub + 5, s.count - 1);
    return shrink(acl, total - s.size);
}

// ---- The tree road ------------------------------------------------------------

// Whether the sub-ACLs the header counts, stepped through by their lengths,
// end exactly at the end of the block, and the last one's entries exactly
// at its own end.  An appended sub-ACL is counted as the one after the
// last; if other bytes lay there (bytes after the last sub-ACL, or entries
// running past its length, both of which validation lets pass), counting
// one more would bring them to life as a sub-ACL that nobody validated.
// And the last sub-ACL, no longer last, would have validation compare its
// entries with its length for the first time: slack inside it would make
// a valid ACL invalid.
bool counted_subacls_fill(const unsigned char *base, size_t total) {
    const unsigned nsub = acl__load_le16(base + 3);
    size_t pos = ACL_HDR_SIZE, last = 0;
    for (unsigned k = 0; k < nsub; ++k) {
        if (total - pos < ACL_SUBACL_HDR_SIZE) return false;
        const size_t len = acl__load_le32(base + pos);
        if (len < ACL_SUBACL_HDR_SIZE || len > total - pos) return false;
        last = pos;
        pos += len;
    }
    if (pos != total) return false;
    if (nsub == 0) return true;
    const unsigned char *sub = base + last;
    const size_t len = total - last;
    size_t at = ACL_SUBACL_HDR_SIZE + size_t{sub[9]};
    if (at > len) return false;
    const uint32_t count = acl__load_le32(sub + 5);
    for (uint32_t e = 0; e < count; ++e) {  // each entry moves on 7 bytes or more
        if (len - at < ACL_ENTRY_HDR_SIZE) return false;
        const size_t idlen = acl__load_le16(sub + at + 5);
        if (len - at - ACL_ENTRY_HDR_SIZE < idlen) return false;
        at += ACL_ENTRY_HDR_SIZE + idlen;
    }
    return at == len;
}

// Put `fresh` in place of the sub-ACL at `where`, or append it when there
// is none.  A growing block is reallocated before the first byte changes,
// so a failure leaves the ACL as it was.  `who` names the operation in a
// memory failure; a shrinking delete then gives the block back as well.
int32_t splice(sec_acl_buffer_t acl, const located &where, const unsigned char *fresh,
               size_t freshlen, const char *who, bool give_back) {
    auto *base = static_cast<unsigned char *>(acl->value);
    const size_t total = static_cast<size_t>(acl->length);
    const size_t old = where.off ? where.len : 0;
    // The header counts sub-ACLs in 16 bits: a 65536th cannot be recorded,
    // so the ACL is refused as unable to take it.
    if (!where.off && acl__load_le16(base + 3) == ACL_MAX_SUBACLS)
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_ACL);
    if (!where.off && !counted_subacls_fill(base, total)) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
    const size_t at = where.off ? where.off : total;
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
    if (!where.off) acl__store_le16(base + 3, static_cast<uint16_t>(acl__load_le16(base + 3) + 1));
    const size_t newtotal = total - old + freshlen;
    // A shorter add (a sub-ACL from outside that held duplicates) keeps its
    // block; a delete gives the spare bytes back.
    if (give_back && newtotal < total) return shrink(acl, newtotal);
    acl->length = static_cast<int32_t>(newtotal);
    return 0;
}

int32_t read_subacl(const sec_acl_buffer_desc *acl, const located &where, sec_acltree_t *tree) {
    *tree = nullptr;
    if (!where.off) return 0;
    return sec__subacl_to_acltree(static_cast<const unsigned char *>(acl->value) + where.off,
                                  where.len, tree);
}

int32_t tree_add(sec_boolean_t noupdate, const sec_acle_desc *e, sec_acl_buffer_t acl,
                 const located &where) {
    sec_acltree_t tree = nullptr;
    int32_t rc = read_subacl(acl, where, &tree);
    if (!rc) rc = sec__add_acle_to_tree(noupdate, e, &tree);
    unsigned char *fresh = nullptr;
    size_t freshlen = 0;
    if (!rc) {
        rc = sec__acltree_to_subacl(tree, &fresh, &freshlen);
        if (!rc && !fresh) rc = acl::set_error(ACL_RC_INTERNAL, acl::msg::INTERNAL, ACL_LOC_ACL, rc);
    }
    sec__free_acltree(tree);
    if (!rc) rc = splice(acl, where, fresh, freshlen, "sec_add_acle_to_acl", false);
    std::free(fresh);
    return rc;
}

int32_t tree_del(const sec_acle_desc *e, sec_acl_buffer_t acl, const located &where) {
    sec_acltree_t tree = nullptr;
    int32_t rc = read_subacl(acl, where, &tree);
    if (!rc && acl__tree_count(tree) == 0)
        rc = acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_NOT_IN_ACL, e->type, e->mech, e->id ? e->id : "");
    if (!rc) rc = sec__del_acle_from_tree(e, tree);
    unsigned char *fresh = nullptr;
    size_t freshlen = 0;
    if (!rc) rc = sec__acltree_to_subacl(tree, &fresh, &freshlen);
    sec__free_acltree(tree);
    if (!rc) {
        if (!fresh) rc = drop_subacl(acl, where);
        else rc = splice(acl, where, fresh, freshlen, "sec_del_acle_from_acl", true);
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
        if (where.off && direct_road(e.type) && acl__edit_direct_enabled.load(std::memory_order_relaxed))
            rc = direct_add(noupdate, &e, acl, where);
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
    if (!where.off)
        return acl::set_error(ACL_RC_NO_MATCH, acl::msg::ACLE_NOT_IN_ACL, e.type, e.mech, e.id ? e.id : "");
    int32_t rc = -1;
    if (direct_road(e.type) && acl__edit_direct_enabled.load(std::memory_order_relaxed))
        rc = direct_del(&e, acl, where);
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
