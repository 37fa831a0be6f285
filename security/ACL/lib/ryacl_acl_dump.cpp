// Readable dump of compiled ACLs, sub-ACLs, trees and entries.  Every line
// is a numbered message recorded in the error slot with return code 1,
// fetched, written and cleared, so that it can be translated like any
// other message; a dump therefore leaves no pending error behind.
#include "ryacl_acl_dump.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "ryacl_acl_buffer.h"
#include "ryacl_acl_entry.h"
#include "ryacl_error.h"

namespace {

// Write the current record and clear the slot.
void emit(FILE *stream, bool extra_newline) {
    acl::report_current_error(stream, extra_newline);
    acl::clear_error();
}

bool dump_entry(const acl__tree_entry_view *e, void *ctx) {
    sec_acle_desc acle{};
    acle.perm = e->perm;
    acle.type = e->type;
    std::memcpy(acle.mech, e->mech, strnlen(e->mech, sizeof acle.mech - 1));
    acle.id = const_cast<char *>(e->id);
    sec__dump_acle(&acle, nullptr, static_cast<const char *>(ctx));
    return true;
}

}  // namespace

void sec__dump_acle(const sec_acle_desc *acle, sec_perm_set_t ptplset, const char *leadspace) {
    if (!acle) return;
    if (!leadspace) leadspace = "";
    char *mech = nullptr, *id = nullptr;
    char perms[33];
    if (sec_display_acle_id(const_cast<sec_acle_t>(acle), &mech, &id) == 0 &&
        sec_translate_bitmask(acle->perm, ptplset, perms) == 0) {
        const char letter = acl__type_letter(acle->type);
        switch (acle->type) {
        case SEC_ACLE_TYPE_UNAUTHENTICATED:
        case SEC_ACLE_TYPE_ANYOTHER: acl::set_error(ACL_RC_INFO, acl::msg::DUMP_ACLE, leadspace, letter, perms); break;
        case SEC_ACLE_TYPE_USER:
        case SEC_ACLE_TYPE_EXPANDED: acl::set_error(ACL_RC_INFO, acl::msg::DUMP_ACLE_MECH_ID, leadspace, letter, mech, id, perms); break;
        case SEC_ACLE_TYPE_GROUP: acl::set_error(ACL_RC_INFO, acl::msg::DUMP_ACLE_ID, leadspace, letter, id, perms); break;
        default: break;  // no line of its own: whatever the slot holds is printed
        }
    }
    emit(stderr, false);
    std::free(mech);
    std::free(id);
}

void sec__dump_acltree(sec_acltree_t tree, const char *leadspace) {
    if (!leadspace) leadspace = "";
    // Ordering a tree read back from a buffer needs no memory; one built
    // out of order may, and if that fails its message stands in for the
    // entries.
    if (acl__tree_visit_named(tree, dump_entry, const_cast<char *>(leadspace), "sec__dump_acltree"))
        emit(stderr, false);
}

// A sub-ACL cut off before its header ends has nothing to show: its
// place gets message 97, on standard output like a sub-ACL that cannot be
// read back.
void sec__dump_subacl(const unsigned char *subacl, size_t avail, const char *leadspace) {
    if (!subacl) return;
    if (!leadspace) leadspace = "";
    if (avail < ACL_SUBACL_HDR_SIZE) {
        acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
        emit(stdout, false);
        return;
    }
    const acl__subacl s = acl__subacl_alone(subacl, avail);
    // The mechanism shown is bounded by the record's 17-byte field and by
    // the bytes present, whatever the length byte claims.
    char mech[17] = {};
    if (acl__type_has_mech(s.type)) {
        size_t n = s.mechlen;
        if (n > avail - ACL_SUBACL_HDR_SIZE) n = avail - ACL_SUBACL_HDR_SIZE;
        if (n > sizeof mech - 1) n = sizeof mech - 1;
        std::memcpy(mech, subacl + ACL_SUBACL_HDR_SIZE, n);
    }
    acl::set_error(ACL_RC_INFO, acl::msg::DUMP_SUBACL, leadspace, leadspace, static_cast<int32_t>(s.length), static_cast<int>(s.type),
                   mech, static_cast<int32_t>(s.count));
    emit(stderr, true);

    sec_acltree_t tree = nullptr;
    if (sec__subacl_to_acltree(subacl, avail, &tree)) {
        emit(stdout, false);
        return;
    }
    // The prefix is at most 6 characters; a longer one is cut there so the
    // entries' prefix fits its 8 bytes.
    char nlead[8];
    size_t n = strnlen(leadspace, 6);
    std::memcpy(nlead, leadspace, n);
    nlead[n] = '\t';
    nlead[n + 1] = '\0';
    sec__dump_acltree(tree, nlead);
    sec__free_acltree(tree);
}

void sec__dump_acl(sec_acl_buffer_t acl) {
    if (!acl || acl->length <= 0 || !acl->value) return;
    const auto *p = static_cast<const unsigned char *>(acl->value);
    const size_t len = static_cast<size_t>(acl->length);
    // A block too short for the header is no ACL either.
    if (p[0] != ACL_BUF_TYPE || len < ACL_HDR_SIZE) {
        acl::set_error(ACL_RC_INFO, acl::msg::ACL_NOT_VALID);
        emit(stderr, true);
        return;
    }
    acl__subacl_cursor<> subs(p, len, acl__walk::lenient);
    acl::set_error(ACL_RC_INFO, acl::msg::DUMP_ACL, acl->length, static_cast<int>(p[1]), static_cast<int>(p[2]),
                   static_cast<int>(acl__load_le16(p + 3)));
    emit(stderr, false);
    // Each sub-ACL is shown with the bytes up to the end of the block, as
    // its entries are located by their count.  One that cannot be located
    // (its header or length running past the block, or the length before
    // it not covering that one's header) ends the dump with message 97.
    acl__subacl s;
    int r;
    while ((r = subs.next(&s)) == 1) sec__dump_subacl(p + s.off, s.avail, "\t");
    if (r < 0) {
        acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
        emit(stdout, false);
    }
}
