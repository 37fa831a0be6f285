// Permission evaluation: what a compiled ACL grants to one identity, or to
// a set of groups.  Works on the caller's bytes in place: no allocation, no
// copy, no tree.  The buffer may not have been validated: the cursor reads
// every entry within the block; a walk that runs off the block reports the
// buffer as corrupted (97), and an identifier whose length does not end on
// its NUL is reported as validation would (114).
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_entry.h"
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

int32_t corrupted(int line) { return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, "security/ACL/lib/ryacl_acl", line); }

// Handlers and comparisons get an identifier in place: it must end on the
// NUL inside its own length (114 otherwise).
bool id_ends(const acl__entry &e) { return e.idlen != 0 && e.id[e.idlen - 1] == '\0'; }

// Walk on to the entry for which cmp gives 0.  An ordered walk (user and
// group entries are stored in ascending order) ends at the first entry for
// which it is negative.  1: *perm is the match's permission; 0: none;
// otherwise a failure, recorded.  The walk and the entry are the function's
// own and it is kept apart from its callers, so they stay in registers, a
// handler's call included; each comparison gets a loop of its own.
template <class Cmp>
[[gnu::noinline]] int32_t match_entry(acl__entry_cursor<> walk, bool ordered, Cmp cmp, uint32_t *perm) {
    acl__entry e;
    int r;
    while ((r = walk.next(&e)) == 1) {
        if (!id_ends(e)) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_ID_LENGTH, ACL_LOC_ACL);
        const int c = cmp(e);
        if (c == 0) {
            *perm = e.perm;
            return 1;
        }
        if (c < 0 && ordered) return 0;
    }
    return r < 0 ? corrupted(__LINE__) : 0;
}

// Without regard to case, the comparison of users and groups.
int32_t match_name(const acl__entry_cursor<> &walk, const char *name, uint32_t *perm) {
    const size_t len = std::strlen(name);
    return match_entry(walk, true, [&](const acl__entry &e) { return zo::casecmp_len(name, len, e.id, e.idlen - 1u); },
                       perm);
}

int32_t no_entry(unsigned type, const char *mech, const char *id) {
    return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::NO_MATCH, type, mech ? mech : "", id ? id : "");
}

int32_t single_perm(sec_acl_buffer_t acl, unsigned char type, const char *mech, const char *zmech,
                    const char *id, uint32_t *perm) {
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__single_acle_perm", 1, 0);
    if (!perm) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__single_acle_perm", 6, 0);
    if (int32_t rc = check_acl(acl)) return rc;
    const unsigned acletype = type & 0x1fu;
    // Groups are evaluated only as a set.
    if (!acl__valid_type(acletype) || acletype == SEC_ACLE_TYPE_GROUP)
        return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_EVAL_TYPE, type);
    const bool named = acl__type_has_mech(acletype);
    if (named && (!mech || !*mech)) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::MECH_REQUIRED);
    if (named && (!id || !*id)) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::ID_REQUIRED);

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
        if (s.count > 1) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::SUBACL_SINGLE_REPEATED, ACL_LOC_ACL);
        // A sub-ACL of no entries (made outside the library) grants nothing
        // and is reported as a missing entry.
        r = walk.next(&e);
        if (r == 0) return no_entry(type, mech, nullptr);
        if (r < 0) return corrupted(__LINE__);
        *perm = e.perm;
        return 0;
    }

    const sec_acl_id_handler handler = acl__eval_handler(acletype, type, mech);
    // Expanded identities are only ever matched by their mechanism's handler.
    if (acletype == SEC_ACLE_TYPE_EXPANDED && !handler) return no_entry(type, mech, id);

    uint32_t granted = 0;
    const int32_t m = handler ? match_entry(walk, acletype == SEC_ACLE_TYPE_USER,
                                            [&](const acl__entry &x) { return handler(id, x.id); }, &granted)
                              : match_name(walk, id, &granted);
    if (m != 1) return m ? m : no_entry(type, mech, id);
    // What a handler records is its own affair, never the caller's; every
    // other way out records its own error over it.
    if (handler) acl::clear_error();
    *perm = granted;
    return 0;
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
    acl__subacl s;
    if (!acl__find_subacl(acl, SEC_ACLE_TYPE_GROUP, nullptr, &s)) return no_entry(SEC_ACLE_TYPE_GROUP, nullptr, nullptr);

    const auto *base = static_cast<const unsigned char *>(acl->value);
    const size_t len = static_cast<size_t>(acl->length);
    uint32_t result = 0;
    bool matched = false;
    for (int32_t g = 0; g < count; ++g) {
        const char *name = static_cast<const char *>(groups[g].value);
        acl__entry_cursor<> walk(base, s, len);
        if (!walk.started()) return corrupted(__LINE__);
        uint32_t granted = 0;
        const int32_t m = match_name(walk, name, &granted);
        if (m > 1) return m;
        if (m == 1) {
            result |= granted;
            matched = true;
        }
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
