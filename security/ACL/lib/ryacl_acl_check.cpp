// Compiled ACLs from outside: validation, byte-order conversion, copying
// caller bytes, creating an empty ACL and releasing one.
//
// A buffer from outside is hostile: its counts and lengths may lie.  Every
// read below is preceded by a test that the bytes are inside the block;
// structure that runs past the end of the block is reported as a corrupted
// buffer (message 97), the way a sub-ACL that does not start where the
// previous one ended is.
#include "ryacl_acl_check.h"

#include <cstdlib>
#include <cstring>

#include "ryacl_acl_cursor.h"
#include "ryacl_acl_entry.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

namespace {

using acl::trace::str;
using acl::trace::val;

int32_t corrupted(int line) { return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, "security/ACL/lib/ryacl_acl", line); }

// The rules of one sub-ACL's header: 0, or 42 with its message.
int32_t check_subacl(const unsigned char *p, size_t len, const acl__subacl &s) {
    const unsigned type = s.type, mlen = s.mechlen;
    if (!acl__valid_type(type)) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_SUBACL_TYPE, type, ACL_LOC_ACL);
    if (!acl__type_has_mech(type)) {
        if (mlen != 0) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::SUBACL_TYPE_WITH_MECH, type, ACL_LOC_ACL);
        if (!acl__type_has_id(type) && s.count > 1) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::SUBACL_SINGLE_REPEATED, ACL_LOC_ACL);
        return 0;
    }
    if (mlen < 2 || mlen > 17) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_SUBACL_MECH_LENGTH, mlen, ACL_LOC_ACL);
    if (!acl__fits(s.off + ACL_SUBACL_HDR_SIZE, mlen, len)) return corrupted(__LINE__);
    const char *m = reinterpret_cast<const char *>(p + s.off + ACL_SUBACL_HDR_SIZE);
    if (strnlen(m, mlen) + 1 != mlen) {
        // The message shows the text; it may lack its NUL here.
        char shown[18];
        std::memcpy(shown, m, mlen);
        shown[mlen] = '\0';
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_SUBACL_MECH, shown, ACL_LOC_ACL);
    }
    return 0;
}

// The rules of one entry: 0; 43 with its message for a fault that ends the
// sub-ACL's entries; 42 (97) for an identifier cut off by the block's end.
int32_t check_entry(const acl__subacl &s, const acl__entry &e) {
    if (e.version != 1) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::BAD_ACLE_VERSION, e.version, ACL_LOC_ACL);
    if (!acl__type_has_id(s.type)) return e.idlen != 0 ? acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_ID_UNEXPECTED, ACL_LOC_ACL) : 0;
    if (!e.id) return corrupted(__LINE__);
    if (e.idlen == 0 || strnlen(e.id, e.idlen) + 1 != e.idlen) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_ID_LENGTH, ACL_LOC_ACL);
    return 0;
}

// Validation and byte-order conversion walk alike: every counted sub-ACL
// must begin where the entries of the one before ended, and nothing is read
// past the block whatever the counts say.  Conversion reads through the
// reversing reader and checks nothing more; validation checks each rule on
// the way.  An entry fault ends its sub-ACL's entries with the walk left on
// the faulty entry, so a later sub-ACL usually reports 97 over it.
template <class Read, bool Verify>
int32_t walk(typename Read::byte *p, size_t len) {
    acl__subacl_cursor<Read> subs(p, len, acl__walk::lenient);
    size_t walked = ACL_HDR_SIZE;
    int32_t rc = 0;
    acl__subacl s;
    for (int r; (r = subs.next(&s)) != 0;) {
        if (r < 0 || s.off != walked) return corrupted(__LINE__);
        if constexpr (Verify)
            if (int32_t f = check_subacl(p, len, s)) return f;
        acl__entry_cursor<Read> entries(p, s, len);
        acl__entry e;
        int32_t fault = 0;
        while ((r = entries.next_header(&e)) == 1) {
            if constexpr (Verify) {
                fault = check_entry(s, e);
                if (fault == ACL_RC_BAD_ACL) return fault;
                if (fault) break;
            }
        }
        if (r < 0) return corrupted(__LINE__);
        if (fault) rc = fault;
        walked = fault ? e.off : entries.pos();
    }
    return rc;
}

}  // namespace

int32_t sec__check_acl_buffer(const sec_acl_buffer_desc *acl) {
    if (acl->length < ACL_HDR_SIZE)
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_TOO_SHORT, acl->length, ACL_LOC_ACL);
    return walk<acl__read_host, true>(static_cast<const unsigned char *>(acl->value),
                                      static_cast<size_t>(acl->length));
}

int32_t sec_convert_acl_to_host(sec_boolean_t verify, sec_acl_buffer_t acl) {
    acl::trace::api_entry(55, 57,
                          {val(verify), val(acl), val(acl ? acl->length : 0),
                           val(acl ? acl->value : nullptr)});
    acl::clear_error();
    int32_t rc = 0;
    auto *p = acl ? static_cast<unsigned char *>(acl->value) : nullptr;
    if (!acl) {
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_convert_acl_to_host", 1, 0);
    } else if (acl->length <= 0 || !p) {
        rc = acl::set_error(ACL_RC_BAD_ACL, acl::msg::NOT_ACL_BUFFER);
    } else if (acl->length < ACL_HDR_SIZE) {
        // Bytes 0 to 4 are the header; a shorter block cannot be walked or
        // reversed, whatever `verify` says.
        rc = acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_TOO_SHORT, acl->length, ACL_LOC_ACL);
    } else if (p[0] != ACL_BUF_TYPE || p[1] != ACL_BUF_VERSION) {
        rc = acl::set_error(ACL_RC_BAD_ACL, acl::msg::NOT_ACL_BUFFER);
    } else if (p[2] == ACL_BUF_HOST_ORDER) {
        acl::trace::point(acl::trace::INFO, 104, {});
        if (verify) rc = sec__check_acl_buffer(acl);
    } else {
        acl::trace::point(acl::trace::INFO, 106, {});
        rc = walk<acl__read_reversing, false>(p, static_cast<size_t>(acl->length));
        // A failure leaves the buffer partly reversed and byte 2 as it was.
        if (!rc) p[2] = ACL_BUF_HOST_ORDER;
    }
    acl::trace::api_exit(58, 59, rc);
    return rc;
}

int32_t sec_read_acl_from_data(int32_t length, const unsigned char *buffer, sec_acl_buffer_t acl) {
    acl::trace::api_entry(15, 17, {val(length), val(buffer), val(acl)});
    acl::clear_error();
    int32_t rc = 0;
    if (length < 1) {
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_read_acl_from_data", 1, length);
    } else if (!buffer) {
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_read_acl_from_data", 2, 0);
    } else if (!acl) {
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_read_acl_from_data", 3, 0);
    } else {
        void *copy = acl__malloc(static_cast<size_t>(length));
        if (!copy) {
            rc = acl__no_memory("sec_read_acl_from_data", length);
        } else {
            std::memcpy(copy, buffer, static_cast<size_t>(length));
            acl->length = length;
            acl->value = copy;
        }
    }
    acl::trace::api_exit(18, 19, rc);
    return rc;
}

int32_t sec_create_empty_acl(sec_acl_buffer_t acl) {
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_create_empty_acl", 1, 0);
    auto *p = static_cast<unsigned char *>(acl__malloc(ACL_HDR_SIZE));
    acl->value = p;
    if (!p) return acl__no_memory("sec_create_empty_acl", ACL_HDR_SIZE);
    acl->length = ACL_HDR_SIZE;
    p[0] = ACL_BUF_TYPE;
    p[1] = ACL_BUF_VERSION;
    p[2] = ACL_BUF_HOST_ORDER;
    acl__store_le16(p + 3, 0);
    return 0;
}

int32_t sec_release_acl(sec_acl_buffer_t acl) {
    acl::trace::api_entry(70, 72,
                          {val(acl), val(acl ? acl->length : 0), val(acl ? acl->value : nullptr)});
    acl::clear_error();
    int32_t rc = 0;
    if (acl && (acl->length != 0 || acl->value)) {
        const auto *p = static_cast<const unsigned char *>(acl->value);
        // Only byte 0 tells whose block this is: an ACL block is freed
        // whatever the length says.  A length without a block is not read
        // through.
        if (!p || p[0] != ACL_BUF_TYPE) {
            rc = acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_ACL);
        } else {
            std::free(acl->value);
            acl->value = nullptr;
            acl->length = 0;
        }
    }
    acl::trace::api_release_exit(73);
    return rc;
}
