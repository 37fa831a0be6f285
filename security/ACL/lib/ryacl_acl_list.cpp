// Listing a compiled ACL as entry records, whole or by type.
//
// The buffer may not have been validated: the sub-ACLs are walked by the
// cursor, each visited one must hold its header (97 otherwise), and each is
// read back within its room.  Sub-ACLs are visited in a loop and each is read
// through a tree that never recurses, so no input makes the stack deep.
#include <cstdlib>
#include <cstring>

#include "ryacl_acl_buffer.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_tree.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

namespace {

using acl::trace::str;
using acl::trace::val;

// Descriptor checks of both listings: an empty descriptor is fine (nothing
// to list); a length and a block that disagree, or a header that is not
// there, are not.  true with *empty set when there is nothing to read.
int32_t check_acl(const sec_acl_buffer_desc *acl, bool *empty) {
    *empty = false;
    if (acl->length == 0 && !acl->value) {
        *empty = true;
        return 0;
    }
    if (acl->length <= 0 || !acl->value) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::NOT_ACL_BUFFER);
    if (acl->length < ACL_HDR_SIZE)
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_TOO_SHORT, acl->length, ACL_LOC_ACL);
    const auto *p = static_cast<const unsigned char *>(acl->value);
    if (p[0] != ACL_BUF_TYPE || p[1] != ACL_BUF_VERSION) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::NOT_ACL_BUFFER);
    return 0;
}

// Expand one sub-ACL onto the list, read within its room: a sub-ACL that
// is not the last may not spill into the next.  Its header must lie there
// too (97 otherwise), for any sub-ACL visited.
int32_t expand(const unsigned char *base, const acl__subacl &s, sec_acle_list_t list, bool wanted) {
    if (!s.header_fits()) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
    if (!wanted) return 0;
    sec_acltree_t tree = nullptr;
    int32_t rc = sec__subacl_to_acltree(base + s.off, s.room(), &tree);
    if (!rc) rc = sec__acltree_to_aclelist(tree, list);
    sec__free_acltree(tree);
    return rc;
}

// Expand every sub-ACL (type 0) or every one of `type`, in buffer order.
int32_t expand_all(const sec_acl_buffer_desc *acl, unsigned type, sec_acle_list_t list) {
    const auto *p = static_cast<const unsigned char *>(acl->value);
    acl__subacl_cursor<> subs(p, static_cast<size_t>(acl->length));
    acl__subacl s;
    int r;
    while ((r = subs.next(&s)) == 1)
        if (int32_t rc = expand(p, s, list, type == 0 || s.type == type)) return rc;
    return r < 0 ? acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL) : 0;
}

// A list that was being filled is emptied by a failure; a list refused
// before that is left as the caller gave it.
int32_t released_on_failure(int32_t rc, sec_acle_list_t list) {
    if (rc) {
        sec_release_aclelist(list);
        // A failure may leave an array grown for entries never moved in:
        // the count is still 0, so the release above does not see it.
        std::free(list->acles);
        list->acles = nullptr;
        list->count = 0;
    }
    return rc;
}

int32_t list_acl(sec_acl_buffer_t acl, sec_acle_list_t list) {
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_list_acl", 1, 0);
    if (!list) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_list_acl", 2, 0);
    bool empty = false;
    if (int32_t rc = check_acl(acl, &empty)) return rc;
    list->count = 0;
    list->acles = nullptr;
    if (empty) return 0;
    return released_on_failure(expand_all(acl, 0, list), list);
}

int32_t list_by_type(sec_acl_buffer_t acl, unsigned char type, const char *mech,
                     sec_acle_list_t list) {
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_list_acl_by_type", 1, 0);
    if (!acl__valid_type(type)) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_list_acl_by_type", 2, type);
    const bool has_mech = acl__type_has_mech(type);
    if (has_mech && mech) {
        const size_t mlen = strnlen(mech, 17);
        if (mlen == 0 || mlen > 16)
            return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_list_acl_by_type", 3,
                                  static_cast<const void *>(mech));
    }
    if (!list) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_list_acl_by_type", 4, 0);
    bool empty = false;
    if (int32_t rc = check_acl(acl, &empty)) return rc;
    list->count = 0;
    list->acles = nullptr;
    if (empty) return 0;
    if (has_mech && !mech) return released_on_failure(expand_all(acl, type, list), list);

    acl__subacl s;
    if (!acl__find_subacl(acl, type, has_mech ? mech : nullptr, &s)) return 0;
    return released_on_failure(expand(static_cast<const unsigned char *>(acl->value), s, list, true), list);
}

}  // namespace

int32_t sec_list_acl(sec_acl_buffer_t acl, sec_acle_list_t aclelist) {
    if (acl)
        acl::trace::api_entry(20, 24, {val(acl->length), val(acl->value), val(aclelist)});
    else
        acl::trace::api_entry(20, 22, {val(acl), val(aclelist)});
    acl::clear_error();
    int32_t rc = list_acl(acl, aclelist);
    acl::trace::api_exit(25, 26, 27, rc, {val(rc ? 0 : aclelist->count)});
    return rc;
}

int32_t sec_list_acl_by_type(sec_acl_buffer_t acl, unsigned char type, const char *mech,
                             sec_acle_list_t aclelist) {
    if (acl)
        acl::trace::api_entry(28, 32,
                              {val(acl->length), val(acl->value), val(type), str(mech), val(aclelist)});
    else
        acl::trace::api_entry(28, 30, {val(acl), val(type), str(mech), val(aclelist)});
    acl::clear_error();
    int32_t rc = list_by_type(acl, type, mech, aclelist);
    acl::trace::api_exit(33, 34, 35, rc, {val(rc ? 0 : aclelist->count)});
    return rc;
}

void sec_release_aclelist(sec_acle_list_t aclelist) {
    acl::trace::api_entry(36, 38, {val(aclelist), val(aclelist ? aclelist->count : 0)});
    if (aclelist && aclelist->count != 0 && aclelist->acles) {
        for (int32_t i = 0; i < aclelist->count; ++i) sec_release_acle(aclelist->acles[i]);
        std::free(aclelist->acles);
        aclelist->acles = nullptr;
        aclelist->count = 0;
    }
    acl::trace::api_release_exit(39);
}
