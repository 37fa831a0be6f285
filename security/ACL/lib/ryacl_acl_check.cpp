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
#include <utility>

#include "ryacl_acl_buffer.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

namespace {

using acl::trace::str;
using acl::trace::val;

void swap16(unsigned char *p) { std::swap(p[0], p[1]); }
void swap32(unsigned char *p) {
    std::swap(p[0], p[3]);
    std::swap(p[1], p[2]);
}

bool fits(size_t pos, size_t need, size_t len) { return pos <= len && need <= len - pos; }

}  // namespace

int32_t sec__check_acl_buffer(const sec_acl_buffer_desc *acl) {
    if (acl->length < ACL_HDR_SIZE)
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_TOO_SHORT, acl->length, ACL_LOC_ACL);
    const auto *p = static_cast<const unsigned char *>(acl->value);
    const size_t len = static_cast<size_t>(acl->length);

    const unsigned nsub = acl__load_le16(p + 3);
    size_t pos = ACL_HDR_SIZE;     // the walk
    size_t expect = ACL_HDR_SIZE;  // where the next sub-ACL must start
    int32_t rc = 0;
    for (unsigned s = 0; s < nsub; ++s) {
        if (pos != expect || !fits(pos, ACL_SUBACL_HDR_SIZE, len))
            return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
        const size_t sublen = acl__load_le32(p + pos);
        // A sub-ACL may not claim bytes beyond the block.
        if (sublen > len - pos) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
        expect = pos + sublen;

        const unsigned type = p[pos + 4];
        const uint32_t count = acl__load_le32(p + pos + 5);
        const unsigned mlen = p[pos + 9];
        if (type != SEC_ACLE_TYPE_UNAUTHENTICATED && type != SEC_ACLE_TYPE_ANYOTHER &&
            type != SEC_ACLE_TYPE_USER && type != SEC_ACLE_TYPE_EXPANDED &&
            type != SEC_ACLE_TYPE_GROUP)
            return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_SUBACL_TYPE, type, ACL_LOC_ACL);
        const bool has_mech = type == SEC_ACLE_TYPE_USER || type == SEC_ACLE_TYPE_EXPANDED;
        const bool has_id = has_mech || type == SEC_ACLE_TYPE_GROUP;
        if (!has_mech) {
            if (mlen != 0) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::SUBACL_TYPE_WITH_MECH, type, ACL_LOC_ACL);
            if (!has_id && count > 1) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::SUBACL_SINGLE_REPEATED, ACL_LOC_ACL);
        } else {
            if (mlen < 2 || mlen > 17) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_SUBACL_MECH_LENGTH, mlen, ACL_LOC_ACL);
            if (!fits(pos + ACL_SUBACL_HDR_SIZE, mlen, len))
                return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
            const char *m = reinterpret_cast<const char *>(p + pos + ACL_SUBACL_HDR_SIZE);
            if (strnlen(m, mlen) + 1 != mlen) {
                // The message shows the text; it may lack its NUL here.
                char shown[18];
                std::memcpy(shown, m, mlen);
                shown[mlen] = '\0';
                return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_SUBACL_MECH, shown, ACL_LOC_ACL);
            }
        }
        pos += ACL_SUBACL_HDR_SIZE + mlen;

        // The count may lie; the bounds test ends the loop at the block's end.
        for (uint32_t e = 0; e < count; ++e) {
            if (!fits(pos, ACL_ENTRY_HDR_SIZE, len))
                return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
            const unsigned version = p[pos];
            const size_t idlen = acl__load_le16(p + pos + 5);
            if (version != 1) {
                rc = acl::set_error(ACL_RC_BAD_ACLE, acl::msg::BAD_ACLE_VERSION, version, ACL_LOC_ACL);
                break;
            }
            if (!has_id) {
                if (idlen != 0) {
                    rc = acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_ID_UNEXPECTED, ACL_LOC_ACL);
                    break;
                }
            } else {
                if (!fits(pos + ACL_ENTRY_HDR_SIZE, idlen, len))
                    return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
                const char *id = reinterpret_cast<const char *>(p + pos + ACL_ENTRY_HDR_SIZE);
                if (idlen == 0 || strnlen(id, idlen) + 1 != idlen) {
                    rc = acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_ID_LENGTH, ACL_LOC_ACL);
                    break;
                }
            }
            pos += ACL_ENTRY_HDR_SIZE + idlen;
        }
    }
    return rc;
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
        const size_t len = static_cast<size_t>(acl->length);
        swap16(p + 3);
        const unsigned nsub = acl__load_le16(p + 3);
        size_t pos = ACL_HDR_SIZE, expect = ACL_HDR_SIZE;
        for (unsigned s = 0; s < nsub && !rc; ++s) {
            if (pos != expect || !fits(pos, ACL_SUBACL_HDR_SIZE, len)) {
                rc = acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
                break;
            }
            swap32(p + pos);
            const size_t sublen = acl__load_le32(p + pos);
            if (sublen > len - pos) {
                rc = acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
                break;
            }
            expect = pos + sublen;
            swap32(p + pos + 5);
            const uint32_t count = acl__load_le32(p + pos + 5);
            pos += ACL_SUBACL_HDR_SIZE + p[pos + 9];
            for (uint32_t e = 0; e < count; ++e) {
                if (!fits(pos, ACL_ENTRY_HDR_SIZE, len)) {
                    rc = acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, ACL_LOC_ACL);
                    break;
                }
                swap32(p + pos + 1);
                swap16(p + pos + 5);
                pos += ACL_ENTRY_HDR_SIZE + acl__load_le16(p + pos + 5);
            }
        }
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
        // A length and a block that disagree (one of them empty, or a
        // negative length) are not read through: byte 0 may not exist.
        if (acl->length <= 0 || !p || p[0] != ACL_BUF_TYPE) {
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
