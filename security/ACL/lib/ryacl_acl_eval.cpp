// Permission evaluation: what a compiled ACL grants to one identity, or to
// a set of groups.  Works on the caller's bytes in place: no allocation, no
// copy, no tree.  The buffer may not have been validated: the cursor reads
// every entry within the block; a walk that runs off the block reports the
// buffer as corrupted (97), and an identifier whose length does not end on
// its NUL is reported as validation would (114).
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
    if (acl->length <= 0 || !p) return acl::set_error(ACL_RC_BAD_ACL, 96);
    if (acl->length < ACL_HDR_SIZE)
        return acl::set_error(ACL_RC_BAD_ACL, 106, acl->length, ACL_LOC_ACL);
    if (p[0] != ACL_BUF_TYPE || p[1] != ACL_BUF_VERSION) return acl::set_error(ACL_RC_BAD_ACL, 96);
    if (p[2] != ACL_BUF_HOST_ORDER) return acl::set_error(ACL_RC_BAD_ACL, 102);
    return 0;
}

int32_t corrupted(int line) { return acl::set_error(ACL_RC_BAD_ACL, 97, "security/ACL/lib/ryacl_acl", line); }

// Handlers and comparisons get an identifier in place: it must end on the
// NUL inside its own length (114 otherwise).
bool id_ends(const acl__entry &e) { return e.idlen != 0 && e.id[e.idlen - 1] == '\0'; }

int32_t no_entry(unsigned type, const char *mech, const char *id) {
    return acl::set_error(ACL_RC_BAD_ACLE, 134, type, mech ? mech : "", id ? id : "");
}

int32_t single_perm(sec_acl_buffer_t acl, unsigned char type, const char *mech, const char *zmech,
                    const char *id, uint32_t *perm) {
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, 88, "sec__single_acle_perm", 1, 0);
    if (!perm) return acl::set_error(ACL_RC_BAD_ARGS, 88, "sec__single_acle_perm", 6, 0);
    if (int32_t rc = check_acl(acl)) return rc;
    const unsigned acletype = type & 0x1fu;
    if (acletype != SEC_ACLE_TYPE_UNAUTHENTICATED && acletype != SEC_ACLE_TYPE_ANYOTHER &&
        acletype != SEC_ACLE_TYPE_USER && acletype != SEC_ACLE_TYPE_EXPANDED)
        return acl::set_error(ACL_RC_BAD_ARGS, 115, type);
    const bool named = acletype == SEC_ACLE_TYPE_USER || acletype == SEC_ACLE_TYPE_EXPANDED;
    if (named && (!mech || !*mech)) return acl::set_error(ACL_RC_BAD_ARGS, 116);
    if (named && (!id || !*id)) return acl::set_error(ACL_RC_BAD_ARGS, 117);

    *perm = 0;
    acl__subacl s;
    if (!acl__find_subacl(acl, static_cast<unsigned char>(acletype), zmech ? zmech : mech, &s))
        return no_entry(type, mech, nullptr);
    // The entries are read up to the end of the block, the sub-ACL's length
    // not consulted.
    const auto *base = static_cast<const unsigned char *>(acl->value);
    acl__entry_cursor<> walk(base, s, static_cast<size_t>(acl->length));
    if (!walk.started()) return corrupted(__LINE__);

    acl__entry e;
    int r;
    if (!named) {
        if (s.count > 1) return acl::set_error(ACL_RC_BAD_ACL, 109, ACL_LOC_ACL);
        // A sub-ACL of no entries (made outside the library) grants nothing
        // and is reported as a missing entry.
        r = walk.next(&e);
        if (r == 0) return no_entry(type, mech, nullptr);
        if (r < 0) return corrupted(__LINE__);
        *perm = e.perm;
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
    while ((r = walk.next(&e)) == 1) {
        if (!id_ends(e)) return acl::set_error(ACL_RC_BAD_ACLE, 114, ACL_LOC_ACL);
        const int c = handler ? handler(id, e.id) : zo::casecmp_len(id, idlen, e.id, e.idlen - 1u);
        if (c == 0) {
            // What a handler records is its own affair, never the caller's;
            // every other way out records its own error over it.
            if (handler) acl::clear_error();
            *perm = e.perm;
            return 0;
        }
        // User entries are stored in ascending order: nothing after an
        // entry that orders after the identity can match.
        if (c < 0 && ordered) break;
    }
    if (r < 0) return corrupted(__LINE__);
    return no_entry(type, mech, id);
}

int32_t group_perm(sec_acl_buffer_t acl, int32_t count, sec_buffer_t groups, uint32_t *perm) {
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, 88, "sec__group_acles_perm", 1, 0);
    if (count != 0 && !groups) return acl::set_error(ACL_RC_BAD_ARGS, 88, "sec__group_acles_perm", 3, 0);
    if (!perm) return acl::set_error(ACL_RC_BAD_ARGS, 88, "sec__group_acles_perm", 4, 0);
    if (int32_t rc = check_acl(acl)) return rc;
    // A name that is not there cannot be compared; refuse the array before
    // anything is written, the way a null array is refused.
    for (int32_t g = 0; g < count; ++g)
        if (!groups[g].value) return acl::set_error(ACL_RC_BAD_ARGS, 88, "sec__group_acles_perm", 3, 0);

    *perm = 0;
    if (count == 0) return 0;
    acl__subacl s;
    if (!acl__find_subacl(acl, SEC_ACLE_TYPE_GROUP, nullptr, &s)) return no_entry(SEC_ACLE_TYPE_GROUP, nullptr, nullptr);

    const auto *base = static_cast<const unsigned char *>(acl->value);
    const size_t len = static_cast<size_t>(acl->length);
    uint32_t result = 0;
    bool matched = false;
    for (int32_t g = 0; g < count; ++g) {
        const char *name = static_cast<const char *>(groups[g].value);
        const size_t namelen = std::strlen(name);
        acl__entry_cursor<> walk(base, s, len);
        if (!walk.started()) return corrupted(__LINE__);
        acl__entry e;
        int r;
        while ((r = walk.next(&e)) == 1) {
            if (!id_ends(e)) return acl::set_error(ACL_RC_BAD_ACLE, 114, ACL_LOC_ACL);
            const int c = zo::casecmp_len(name, namelen, e.id, e.idlen - 1u);
            if (c == 0) {
                result |= e.perm;
                matched = true;
                break;
            }
            if (c < 0) break;
        }
        if (r < 0) return corrupted(__LINE__);
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
