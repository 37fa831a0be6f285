// ACL entries and permission templates: the default template set, creating,
// displaying and releasing entries, and translation between permission
// letters and bit masks.
#include "ryacl_acl_entry.h"

#include <arpa/inet.h>
#include <netinet/in.h>

#include <cstdlib>
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"
#include "ryacl_utils.h"

namespace trace = acl::trace;

extern "C" {

constexpr sec_perm_desc acl__default_perm_list[13] = {
    {0x00000001u, 'r', "read", "general purpose read operation"},
    {0x00000002u, 'w', "write", "general purpose write operation"},
    {0x00000004u, 'c', "control", "general purpose control operation"},
    {0x00000008u, 'x', "execute", "general purpose execute operation"},
    {0x00000010u, 'C', "cancel", "general purpose cancel operation"},
    {0x00000020u, 'q', "query", "HVT query resource"},
    {0x00000040u, 'l', "list", "HVT enumerate resource"},
    {0x00000080u, 'e', "event", "HVT event registration/unregistration/quering"},
    {0x00000100u, 'd', "define", "HVT define/undefine resource"},
    {0x00000200u, 'v', "validate", "HVT validate resource handle"},
    {0x00000400u, 's', "set", "HVT set attribute"},
    {0x00000800u, 'a', "set", "HVT administrative control"},
    {0x00001000u, 'o', "set", "HVT online/offline/reset resource"},
};

// The record's pointer is not const-qualified (it is the public template set
// type); nothing writes through it, and the templates stay in read-only memory.
const sec_perm_set_desc acl__default_perm_set = {13, const_cast<sec_perm_t>(acl__default_perm_list)};

}  // extern "C"

char acl__type_letter(unsigned t) {
    switch (t) {
    case SEC_ACLE_TYPE_UNAUTHENTICATED: return 'n';
    case SEC_ACLE_TYPE_ANYOTHER: return 'o';
    case SEC_ACLE_TYPE_USER: return 'u';
    case SEC_ACLE_TYPE_EXPANDED: return 'e';
    case SEC_ACLE_TYPE_GROUP: return 'g';
    default: return '?';
    }
}

namespace {

constexpr size_t MECH_MAX = 16;

// Message 88's parameter value is the pointer itself, not the text.
int32_t bad_param(const char *fn, int pos, const void *value) {
    return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, fn, pos, value);
}

// Copy a mechanism of at most 16 bytes into the record; a longer one cannot
// be stored.  A UTF-8 form that grew past 16 bytes is refused like a too long
// mechanism given by the caller: message 88 for parameter 3, the nearest
// description of the fault the catalog has.
int32_t store_mech(sec_acle_t rec, const char *mech, const char *given) {
    size_t len = strnlen(mech, MECH_MAX + 1);
    if (len > MECH_MAX) return bad_param("sec__create_acle", 3, given);
    std::memcpy(rec->mech, mech, len);
    rec->mech[len] = '\0';
    return ACL_RC_OK;
}

int32_t create_acle(unsigned char type, uint32_t perm, const char *mech, const char *id,
                    sec_boolean_t translate, sec_acle_t *acle) {
    *acle = nullptr;
    auto *rec = static_cast<sec_acle_t>(acl__calloc(1, sizeof(sec_acle_desc)));
    if (!rec) return acl__no_memory("sec__create_acle", sizeof(sec_acle_desc));
    rec->perm = perm;
    rec->type = type;

    int32_t rc = ACL_RC_OK;
    // Internal callers validate first; absent texts are still refused here
    // rather than dereferenced.
    if (acl__type_has_mech(type)) {
        if (!mech) {
            rc = bad_param("sec__create_acle", 3, mech);
        } else if (translate) {
            size_t inlen = std::strlen(mech) + 1, outlen = 0;
            char *out = nullptr;
            rc = acl__convert_to_utf8(mech, &inlen, &out, &outlen);
            if (rc == ACL_RC_OK) {
                rc = store_mech(rec, out, mech);
                std::free(out);
            }
        } else {
            rc = store_mech(rec, mech, mech);
        }
    }
    if (rc == ACL_RC_OK && acl__type_has_id(type)) {
        if (!id) {
            rc = bad_param("sec__create_acle", 4, id);
        } else if (translate) {
            size_t inlen = std::strlen(id) + 1, outlen = 0;
            char *out = nullptr;
            rc = acl__convert_to_utf8(id, &inlen, &out, &outlen);
            if (rc == ACL_RC_OK) rec->id = out;
        } else {
            rec->id = acl__strdup(id);
            if (!rec->id)
                rc = acl__no_memory("sec__create_acle", std::strlen(id) + 1);
        }
    }
    if (rc != ACL_RC_OK) {
        std::free(rec->id);
        std::free(rec);
        return rc;
    }
    *acle = rec;
    return ACL_RC_OK;
}

// Validation and IPv6 normalisation of sec_create_acle.  *built receives
// the rewritten identity when one was made; the caller frees it.
int32_t create_acle_checked(unsigned char type, uint32_t perm, const char *mech, const char *id,
                            sec_acle_t *acle, char **built) {
    if (!acl__valid_type(type)) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_create_acle", 1, type);
    if (acl__type_has_mech(type) && (!mech || !*mech || strnlen(mech, MECH_MAX + 1) > MECH_MAX))
        return bad_param("sec_create_acle", 3, mech);
    if (acl__type_has_id(type) && (!id || !*id)) return bad_param("sec_create_acle", 4, id);
    if (!acle) return bad_param("sec_create_acle", 5, acle);

    const char *identity = id;
    if (acl__type_has_mech(type) && (std::strcmp(mech, "unix") == 0 || std::strcmp(mech, "hba2") == 0)) {
        const char *at = std::strchr(id, '@');
        if (!at && type == SEC_ACLE_TYPE_USER) return bad_param("sec_create_acle", 4, id);
        const char *rgyname = at ? at + 1 : id;
        if (!*rgyname) return bad_param("sec_create_acle", 4, id);

        unsigned char addr[16];
        if (inet_pton(AF_INET6, rgyname, addr) > 0) {
            char rrgyname[65] = {};
            int nrc = zo_ipaddr_ntop_1(addr, rrgyname, sizeof rrgyname);
            if (nrc != 0) return acl::set_error(ACL_RC_INTERNAL, acl::msg::INTERNAL, ACL_LOC_ACL, nrc);
            size_t prefix = static_cast<size_t>(rgyname - id);
            size_t canon = strnlen(rrgyname, sizeof rrgyname - 1);
            size_t need = prefix + canon + 1;
            *built = static_cast<char *>(acl__malloc(need));
            if (!*built) return acl__no_memory("sec_create_acle", need);
            std::memcpy(*built, id, prefix);
            std::memcpy(*built + prefix, rrgyname, canon);
            (*built)[prefix + canon] = '\0';
            identity = *built;
        }
    }
    return create_acle(type, perm, mech, identity, 1, acle);
}

// Copy of a converted text from UTF-8; *out stays null on failure.
int32_t from_utf8(const char *text, char **out) {
    size_t inlen = std::strlen(text) + 1, outlen = 0;
    char *res = nullptr;
    int32_t rc = acl__convert_from_utf8(text, &inlen, &res, &outlen);
    *out = rc == ACL_RC_OK ? res : nullptr;
    return rc;
}

int32_t display_acle_id(sec_acle_t acle, char **mech, char **id) {
    if (!acle) return bad_param("sec_display_acle_id", 1, acle);
    if (!mech) return bad_param("sec_display_acle_id", 2, mech);
    if (!id) return bad_param("sec_display_acle_id", 3, id);
    *mech = nullptr;
    *id = nullptr;

    switch (acle->type) {
    case SEC_ACLE_TYPE_UNAUTHENTICATED:
    case SEC_ACLE_TYPE_ANYOTHER:
        return ACL_RC_OK;
    case SEC_ACLE_TYPE_GROUP:
        if (!acle->id || !*acle->id) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_LACKS_MECH_OR_ID);
        return from_utf8(acle->id, id);
    case SEC_ACLE_TYPE_USER:
    case SEC_ACLE_TYPE_EXPANDED: {
        // A mechanism without its NUL inside the 17 bytes is as invalid as an
        // empty one, and must not be read past the field.
        if (!acle->mech[0] || acle->mech[MECH_MAX] != '\0' || !acle->id || !*acle->id)
            return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_LACKS_MECH_OR_ID);
        int32_t rc = from_utf8(acle->mech, mech);
        if (rc == ACL_RC_OK) rc = from_utf8(acle->id, id);
        if (rc != ACL_RC_OK) {
            std::free(*mech);
            std::free(*id);
            *mech = nullptr;
            *id = nullptr;
        }
        return rc;
    }
    default:
        return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_NOT_USER_OR_GROUP, acle->type);
    }
}


// A caller may have overwritten the mechanism's NUL; record no more than the
// field holds.
trace::item mech_field(sec_acle_t acle) {
    return acle ? trace::strn(acle->mech, sizeof acle->mech) : trace::str(nullptr);
}

}  // namespace

int32_t sec__create_acle(unsigned char type, uint32_t perm, const char *mech, const char *id,
                         sec_boolean_t translate, sec_acle_t *acle) {
    return create_acle(type, perm, mech, id, translate, acle);
}

namespace {

// The default set's letters as one lookup each: every file entry's
// permissions go through it.  0 marks a letter that is no template's (no
// default template has code 0).  Built from the list itself, which never
// changes, so the two cannot disagree.
struct letter_table {
    uint32_t code[256] = {};
    constexpr letter_table() {
        for (int32_t i = 13; i-- > 0;)  // the first template of a letter wins
            code[static_cast<unsigned char>(acl__default_perm_list[i].printchar)] = acl__default_perm_list[i].code;
    }
};

// Built by the compiler: no call pays for a guard, and no order of static
// initialisers can find it empty.
constexpr letter_table g_letters;

bool is_default_set(const sec_perm_set_desc *permset) {
    return permset == &acl__default_perm_set && permset->perms == acl__default_perm_list && permset->count == 13;
}

}  // namespace

int32_t sec__translate_perms(const char *ps, const sec_perm_set_desc *permset, uint32_t *perm) {
    if (is_default_set(permset)) {
        uint32_t bits = 0;
        for (const char *c = ps; *c; ++c) {
            const uint32_t code = g_letters.code[static_cast<unsigned char>(*c)];
            if (!code) {
                *perm |= bits;
                return acl::set_error(ACL_RC_PERMISSION, acl::msg::BAD_PERM_LETTER, static_cast<unsigned char>(*c));
            }
            bits |= code;
        }
        *perm |= bits;
        return ACL_RC_OK;
    }
    const int32_t count = permset->count > 0 && permset->perms ? permset->count : 0;
    for (const char *c = ps; *c; ++c) {
        int32_t i = 0;
        while (i < count && permset->perms[i].printchar != *c) ++i;
        if (i == count)
            return acl::set_error(ACL_RC_PERMISSION, acl::msg::BAD_PERM_LETTER, static_cast<unsigned char>(*c));
        *perm |= permset->perms[i].code;
    }
    return ACL_RC_OK;
}

int32_t sec__translate_bitmask(uint32_t pbm, const sec_perm_set_desc *permset, char *perm) {
    const int32_t count = permset->count > 0 && permset->perms ? permset->count : 0;
    size_t out = 0;  // at most 32 letters: one per bit
    int32_t rc = ACL_RC_OK;
    for (unsigned bitpos = 0; bitpos < 32 && rc == ACL_RC_OK; ++bitpos) {
        const uint32_t bit = uint32_t{1} << bitpos;
        if (!(pbm & bit)) continue;
        int32_t i = 0;
        while (i < count && permset->perms[i].code != bit) ++i;
        if (i == count) rc = acl::set_error(ACL_RC_PERMISSION, acl::msg::BAD_PERM_BIT, bit);
        else perm[out++] = permset->perms[i].printchar;
    }
    // Terminated on failure too, so a careless reader of the area stays in it.
    perm[out] = '\0';
    return rc;
}

extern "C" {

int32_t sec_create_acle(unsigned char type, uint32_t perm, const char *mech, const char *id,
                        sec_acle_t *acle) {
    const uint32_t type32 = type;
    const void *result_addr = acle;
    trace::api_entry(40, 42, {trace::val(type32), trace::val(perm), trace::str(mech), trace::str(id),
                              trace::val(result_addr)});
    acl::clear_error();
    char *built = nullptr;
    int32_t rc = create_acle_checked(type, perm, mech, id, acle, &built);
    std::free(built);
    trace::api_exit(43, 44, rc);
    return rc;
}

void sec_release_acle(sec_acle_t acle) {
    const void *addr = acle;
    const unsigned char type = acle ? acle->type : 0;
    const uint32_t perm = acle ? acle->perm : 0;
    trace::api_entry(45, 47, {trace::val(addr), trace::val(type), trace::val(perm), mech_field(acle),
                              trace::str(acle ? acle->id : nullptr)});
    if (acle) {
        std::free(acle->id);
        std::free(acle);
    }
    trace::api_release_exit(48);
}

int32_t sec_display_acle_id(sec_acle_t acle, char **mech, char **id) {
    const void *addr = acle;
    const void *mech_addr = mech;
    const void *id_addr = id;
    const unsigned char type = acle ? acle->type : 0;
    const uint32_t perm = acle ? acle->perm : 0;
    trace::api_entry(49, 51, {trace::val(addr), trace::val(type), trace::val(perm), mech_field(acle),
                              trace::str(acle ? acle->id : nullptr), trace::val(mech_addr),
                              trace::val(id_addr)});
    acl::clear_error();
    int32_t rc = display_acle_id(acle, mech, id);
    if (rc == ACL_RC_OK) trace::api_exit(52, 53, 54, rc, {trace::str(*mech), trace::str(*id)});
    else trace::api_exit(52, 53, rc);
    return rc;
}

int32_t sec_translate_perms(const char *perms, sec_perm_set_t permset, uint32_t *bitmask) {
    const void *set_addr = permset;
    const void *result_addr = bitmask;
    trace::api_entry(91, 93, {trace::str(perms, "<nil>"), trace::val(set_addr), trace::val(result_addr)});
    int32_t rc = ACL_RC_OK;
    if (!bitmask) {
        rc = bad_param("sec_translate_perms", 3, bitmask);
    } else {
        *bitmask = 0;
        if (perms) rc = sec__translate_perms(perms, permset ? permset : &acl__default_perm_set, bitmask);
    }
    if (rc == ACL_RC_OK) trace::api_exit(94, 95, 96, rc, {trace::val(*bitmask)});
    else trace::api_exit(94, 95, rc);
    return rc;
}

int32_t sec_translate_bitmask(uint32_t bitmask, sec_perm_set_t permset, char *perms) {
    const void *set_addr = permset;
    // The caller's area is output only and may be uninitialised: it is
    // emptied first, so the entry point records the text it holds from then
    // on and never a byte the caller did not write.
    if (perms) perms[0] = '\0';
    trace::api_entry(97, 99, {trace::val(bitmask), trace::val(set_addr), trace::str(perms, "<nil>")});
    int32_t rc = ACL_RC_OK;
    if (!perms) {
        rc = bad_param("sec_translate_mask", 3, perms);
    } else {
        if (bitmask) rc = sec__translate_bitmask(bitmask, permset ? permset : &acl__default_perm_set, perms);
    }
    if (rc == ACL_RC_OK) trace::api_exit(100, 101, 102, rc, {trace::str(perms)});
    else trace::api_exit(100, 101, rc);
    return rc;
}

}  // extern "C"
