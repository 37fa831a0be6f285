// Permission evaluation: what a compiled ACL grants to one identity, or to
// a set of groups.  Works on the caller's bytes in place: no allocation, no
// copy, no tree.  The buffer may not have been validated, so every entry is
// bounds-checked against the block before it is read; a walk that runs off
// the block reports the buffer as corrupted (97), and an identifier whose
// length does not end on its NUL is reported as validation would (114).
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_error.h"
#include "ryacl_init.h"
#include "ryacl_trace.h"

namespace {

using acl::trace::str;
using acl::trace::val;

// Header checks shared by both evaluations.  A block shorter than the
// header is refused before any byte of it is read.
int32_t check_acl(const sec_acl_buffer_desc *acl) {
    const auto *p = static_cast<const unsigned char *>(acl->value);
    if (acl->length <= 0 || !p) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::NOT_ACL_BUFFER);
    if (acl->length < ACL_HDR_SIZE)
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_TOO_SHORT, acl->length, ACL_LOC_ACL);
    if (p[0] != ACL_BUF_TYPE || p[1] != ACL_BUF_VERSION) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::NOT_ACL_BUFFER);
    if (p[2] != ACL_BUF_HOST_ORDER) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_BYTE_ORDER);
    return 0;
}

// The entries of one sub-ACL, walked within the block.
class entry_walk {
public:
    // False when the sub-ACL header itself runs off the block.
    bool open(const sec_acl_buffer_desc *acl, const unsigned char *sub) {
        end_ = static_cast<const unsigned char *>(acl->value) + acl->length;
        if (end_ - sub < ACL_SUBACL_HDR_SIZE) return false;
        const unsigned mlen = sub[9];
        if (static_cast<size_t>(end_ - sub) < ACL_SUBACL_HDR_SIZE + size_t{mlen}) return false;
        left_ = acl__load_le32(sub + 5);
        cur_ = sub + ACL_SUBACL_HDR_SIZE + mlen;
        return true;
    }
    uint32_t count_left() const { return left_; }
    // Step to the next entry.  1: *perm and *id (null for an entry without
    // an identifier) describe it; 0: no entries left; otherwise the return
    // code of a corrupted entry, with the error recorded.
    int32_t next(bool with_id, uint32_t *perm, const char **id, size_t *idtextlen = nullptr) {
        if (left_ == 0) return 0;
        if (end_ - cur_ < ACL_ENTRY_HDR_SIZE) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
        const size_t idlen = acl__load_le16(cur_ + 5);
        if (static_cast<size_t>(end_ - cur_ - ACL_ENTRY_HDR_SIZE) < idlen)
            return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
        *perm = acl__load_le32(cur_ + 1);
        const char *text = reinterpret_cast<const char *>(cur_ + ACL_ENTRY_HDR_SIZE);
        if (with_id) {
            // Handlers and comparisons get the identifier in place; it must
            // end inside its own length.
            if (idlen == 0 || text[idlen - 1] != '\0')
                return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_ID_LENGTH, ACL_LOC_ACL);
            *id = text;
            if (idtextlen) *idtextlen = idlen - 1;
        } else {
            *id = nullptr;
        }
        cur_ += ACL_ENTRY_HDR_SIZE + idlen;
        --left_;
        return 1;
    }

private:
    const unsigned char *cur_ = nullptr;
    const unsigned char *end_ = nullptr;
    uint32_t left_ = 0;
};

int32_t no_entry(unsigned type, const char *mech, const char *id) {
    return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::NO_MATCH, type, mech ? mech : "", id ? id : "");
}

int32_t single_perm(sec_acl_buffer_t acl, unsigned char type, const char *mech, const char *zmech,
                    const char *id, uint32_t *perm) {
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__single_acle_perm", 1, 0);
    if (!perm) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__single_acle_perm", 6, 0);
    if (int32_t rc = check_acl(acl)) return rc;
    const unsigned acletype = type & 0x1fu;
    if (acletype != SEC_ACLE_TYPE_UNAUTHENTICATED && acletype != SEC_ACLE_TYPE_ANYOTHER &&
        acletype != SEC_ACLE_TYPE_USER && acletype != SEC_ACLE_TYPE_EXPANDED)
        return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_EVAL_TYPE, type);
    const bool named = acletype == SEC_ACLE_TYPE_USER || acletype == SEC_ACLE_TYPE_EXPANDED;
    if (named && (!mech || !*mech)) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::MECH_REQUIRED);
    if (named && (!id || !*id)) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::ID_REQUIRED);

    *perm = 0;
    unsigned char *sub = nullptr;
    sec__find_subacl(acl, static_cast<unsigned char>(acletype), zmech ? zmech : mech, &sub);
    if (!sub) return no_entry(type, mech, nullptr);
    entry_walk walk;
    if (!walk.open(acl, sub)) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);

    uint32_t eperm = 0;
    const char *eid = nullptr;
    if (!named) {
        if (walk.count_left() > 1) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::SUBACL_SINGLE_REPEATED, ACL_LOC_ACL);
        // A sub-ACL of no entries (made outside the library) grants nothing
        // and is reported as a missing entry.
        int32_t r = walk.next(false, &eperm, &eid);
        if (r == 0) return no_entry(type, mech, nullptr);
        if (r != 1) return r;
        *perm = eperm;
        return 0;
    }

    sec_acl_id_handler handler = nullptr;
    if (acletype == SEC_ACLE_TYPE_EXPANDED) {
        sec__get_id_handler(SEC_ID_HANDLER_EXPANDED, mech, &handler);
        // Expanded identities are only ever matched by their mechanism's
        // handler.
        if (!handler) return no_entry(type, mech, id);
    } else if (type & SEC_ACLE_USE_ID_HANDLER) {
        sec__get_id_handler(SEC_ID_HANDLER_USER, mech, &handler);
    }

    const bool ordered = acletype == SEC_ACLE_TYPE_USER;
    const size_t idlen = std::strlen(id);
    size_t eidlen = 0;
    int32_t r;
    while ((r = walk.next(true, &eperm, &eid, &eidlen)) == 1) {
        int c;
        c = handler ? handler(id, eid) : zo::casecmp_len(id, idlen, eid, eidlen);
        if (c == 0) {
            // What a handler records is its own affair, never the caller's;
            // every other way out records its own error over it.
            if (handler) acl::clear_error();
            *perm = eperm;
            return 0;
        }
        // User entries are stored in ascending order: nothing after an
        // entry that orders after the identity can match.
        if (c < 0 && ordered) break;
    }
    if (r > 1) {
        *perm = 0;
        return r;
    }
    return no_entry(type, mech, id);
}

int32_t group_perm(sec_acl_buffer_t acl, int32_t count, sec_buffer_t groups, uint32_t *perm) {
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__group_acles_perm", 1, 0);
    if (count != 0 && !groups) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__group_acles_perm", 3, 0);
    if (!perm) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__group_acles_perm", 4, 0);
    if (int32_t rc = check_acl(acl)) return rc;
    // A name that is not there cannot be compared; refuse the array before
    // anything is written, the way a null array is refused.
    for (int32_t g = 0; g < count; ++g)
        if (!groups[g].value) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__group_acles_perm", 3, 0);

    *perm = 0;
    if (count == 0) return 0;
    unsigned char *sub = nullptr;
    sec__find_subacl(acl, SEC_ACLE_TYPE_GROUP, nullptr, &sub);
    if (!sub) return no_entry(SEC_ACLE_TYPE_GROUP, nullptr, nullptr);

    uint32_t result = 0;
    bool matched = false;
    for (int32_t g = 0; g < count; ++g) {
        const char *name = static_cast<const char *>(groups[g].value);
        const size_t namelen = std::strlen(name);
        entry_walk walk;
        if (!walk.open(acl, sub)) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
        uint32_t eperm = 0;
        const char *eid = nullptr;
        size_t eidlen = 0;
        int32_t r;
        while ((r = walk.next(true, &eperm, &eid, &eidlen)) == 1) {
            int c = zo::casecmp_len(name, namelen, eid, eidlen);
            if (c == 0) {
                result |= eperm;
                matched = true;
                break;
            }
            if (c < 0) break;
        }
        if (r > 1) return r;
    }
    if (!matched) return no_entry(SEC_ACLE_TYPE_GROUP, nullptr, nullptr);
    *perm = result;
    return 0;
}

}  // namespace

int32_t sec__single_acle_perm(sec_acl_buffer_t acl, unsigned char type, const char *mech,
                              const char *zmech, const char *id, uint32_t *perm) {
    // The items are only built when the point is on: an evaluation is
    // called per request and must not pay for texts it never records.
    const bool api = acl::trace::level(acl::trace::API) != 0;
    if (api)
        acl::trace::api_entry(79, 81,
                              {val(acl), val(acl ? acl->length : 0), val(acl ? acl->value : nullptr),
                               val(type), str(mech), str(id), val(perm)});
    acl::trace::perf_timer timer(2);
    acl::clear_error();
    acl__state_ensure_init();
    int32_t rc = single_perm(acl, type, mech, zmech, id, perm);
    if (timer.armed()) timer.record(7, {val(type), str(mech), str(id)});
    if (api) acl::trace::api_exit(82, 83, 84, rc, {val(rc ? 0u : *perm)});
    return rc;
}

int32_t sec__group_acles_perm(sec_acl_buffer_t acl, int32_t count, sec_buffer_t groups,
                              uint32_t *perm) {
    const bool api = acl::trace::level(acl::trace::API) != 0;
    if (api)
        acl::trace::api_entry(85, 87,
                              {val(acl), val(acl ? acl->length : 0), val(acl ? acl->value : nullptr),
                               val(count), val(groups), val(perm)});
    acl::trace::perf_timer timer(2);
    acl::clear_error();
    acl__state_ensure_init();
    int32_t rc = group_perm(acl, count, groups, perm);
    if (timer.armed()) timer.record(8, {val(count)});
    if (api) acl::trace::api_exit(88, 89, 90, rc, {val(rc ? 0u : *perm)});
    return rc;
}
