// The compiled ACL: serialising trees into sub-ACLs and whole buffers,
// reading a sub-ACL back into a tree, finding a sub-ACL.
//
// Writers size the result first and allocate it once, so the cost is that
// of the bytes written.  Readers take buffers that may come from outside
// unvalidated: every count and length is checked against the bytes that
// are really there before it is followed.
#include "ryacl_acl_buffer.h"

#include <cstdlib>
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl_acl_entry.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"

namespace {

constexpr size_t kMechField = 17;  // the entry record's mechanism field

int32_t size_arg(size_t n) { return n > INT32_MAX ? INT32_MAX : static_cast<int32_t>(n); }

// Size of the sub-ACL a tree serialises to (0 for a tree without entries)
// and its entry count.  Refuses what the layout cannot hold instead of
// writing a wrapped 16-bit length or an over-long 32-bit one:
//  - an identifier over 65534 bytes: 43 with message 95, the message for an
//    entry whose identifier is not valid;
//  - a sub-ACL over INT32_MAX bytes: 6 with message 89, the allocation the
//    layout cannot express (the size shown is capped at INT32_MAX).
int32_t subacl_size(sec_acltree_s *tree, const char *fname, size_t *size, size_t *count) {
    uint64_t id_bytes = 0;
    bool too_long_id = false;
    acl__tree_stats(tree, count, &id_bytes, &too_long_id);
    *size = 0;
    if (*count == 0) return 0;
    const unsigned char type = acl__tree_type(tree);
    if (too_long_id) return acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_LACKS_MECH_OR_ID);
    uint64_t total = ACL_SUBACL_HDR_SIZE;
    if (acl__type_has_mech(type)) total += acl__tree_mechlen(tree) + 1;
    total += uint64_t{*count} * ACL_ENTRY_HDR_SIZE;
    if (acl__type_has_id(type)) total += id_bytes + *count;
    if (total > INT32_MAX) return acl__no_memory(fname, INT32_MAX);
    *size = static_cast<size_t>(total);
    return 0;
}

// Serialised bytes go into an area: the whole result block, or a staging
// area that is handed to a sink whenever the next record would not fit.
struct writer {
    unsigned char *base;
    unsigned char *p;
    size_t left;
    const acl__byte_sink *sink = nullptr;  // null: the area is the whole result
    size_t cap = 0;                        // staging area size
    uint64_t written = 0;                  // bytes laid down so far
    int32_t rc = 0;                        // the sink's failure
    bool overflow = false;

    int32_t flush() {
        const size_t used = static_cast<size_t>(p - base);
        if (sink && used) rc = sink->put(sink->ctx, base, used);
        p = base;
        left = cap;
        return rc;
    }
    // Room for n more bytes; a staging area is always at least one record.
    unsigned char *take(size_t n) {
        if (left < n && (!sink || flush() != 0 || left < n)) {
            overflow = overflow || rc == 0;
            return nullptr;
        }
        unsigned char *at = p;
        p += n;
        left -= n;
        written += n;
        return at;
    }
};

bool write_entry(const acl__tree_entry_view *e, void *ctx) {
    auto *w = static_cast<writer *>(ctx);
    const size_t idfield = e->id ? e->idlen + 1 : 0;
    unsigned char *p = w->take(ACL_ENTRY_HDR_SIZE + idfield);
    if (!p) return false;
    p[0] = 1;
    acl__store_le32(p + 1, e->perm);
    acl__store_le16(p + 5, static_cast<uint16_t>(idfield));
    if (idfield) std::memcpy(p + ACL_ENTRY_HDR_SIZE, e->id, idfield);
    return true;
}

// Lay down the sub-ACL of `tree`: exactly `size` bytes.
int32_t write_subacl(sec_acltree_s *tree, writer *w, size_t size, size_t count, const char *fname) {
    const unsigned char type = acl__tree_type(tree);
    const char *mech = acl__type_has_mech(type) ? acl__tree_mech(tree) : "";
    const size_t mechfield = acl__type_has_mech(type) ? acl__tree_mechlen(tree) + 1 : 0;
    const uint64_t start = w->written;
    if (unsigned char *dst = w->take(ACL_SUBACL_HDR_SIZE + mechfield)) {
        acl__store_le32(dst, static_cast<uint32_t>(size));
        dst[4] = type;
        acl__store_le32(dst + 5, static_cast<uint32_t>(count));
        dst[9] = static_cast<unsigned char>(mechfield);
        std::memcpy(dst + ACL_SUBACL_HDR_SIZE, mech, mechfield);
        if (int32_t rc = acl__tree_visit_named(tree, write_entry, w, fname)) return rc;
    }
    if (w->rc) return w->rc;
    // The sizes come from the same entries; a mismatch is a defect here.
    if (w->overflow || w->written - start != size) return acl::set_error(ACL_RC_INTERNAL, acl::msg::INTERNAL, ACL_LOC_ACL, 0);
    return 0;
}

// Before tree s of many is sized or written: fetch the trees a few places
// further down ahead, each a step further along its chain of blocks (see
// acl__tree_visit_prefetch), so that a file of thousands of small sub-ACLs
// does not wait on memory once per block per tree.
void fetch_ahead(const acl__trees_s *trees, int32_t s, bool texts) {
    if (s >= 8) acl__tree_visit_prefetch(trees->trees[s - 8], 0);
    if (s >= 4) acl__tree_visit_prefetch(trees->trees[s - 4], 1);
    if (texts && s >= 2) acl__tree_visit_prefetch(trees->trees[s - 2], 2);
}

// Size of the compiled ACL of every tree, refusing what its header cannot
// describe.
int32_t acltrees_size(const acl__trees_s *trees, const char *fname, acl__acl_plan *plan) {
    const int32_t n = trees ? trees->nooftrees : 0;
    uint64_t total = ACL_HDR_SIZE;
    size_t nsub = 0;
    for (int32_t s = n; s-- > 0;) {
        fetch_ahead(trees, s, false);
        size_t size = 0, count = 0;
        if (int32_t rc = subacl_size(trees->trees[s], fname, &size, &count)) return rc;
        if (!size) continue;
        total += size;
        ++nsub;
        // The header counts sub-ACLs in 16 bits: one more is a limit of
        // the format, told as such (167).  Past INT32_MAX bytes it is an
        // allocation beyond the buffer's own limit (6, message 89).
        if (nsub > ACL_MAX_SUBACLS) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::TOO_MANY_SUBACLS, ACL_MAX_SUBACLS);
        if (total > INT32_MAX) return acl__no_memory(fname, size_arg(total));
    }
    *plan = {static_cast<size_t>(total), nsub};
    return 0;
}

// The buffer header and every non-empty sub-ACL, last slot first.
int32_t write_acltrees(const acl__trees_s *trees, size_t nsub, writer *w, const char *fname) {
    unsigned char *h = w->take(ACL_HDR_SIZE);
    if (!h) return w->rc ? w->rc : acl::set_error(ACL_RC_INTERNAL, acl::msg::INTERNAL, ACL_LOC_ACL, 0);
    h[0] = ACL_BUF_TYPE;
    h[1] = ACL_BUF_VERSION;
    h[2] = ACL_BUF_HOST_ORDER;
    acl__store_le16(h + 3, static_cast<uint16_t>(nsub));
    for (int32_t s = trees ? trees->nooftrees : 0; s-- > 0;) {
        fetch_ahead(trees, s, true);
        size_t size = 0, count = 0;
        if (int32_t rc = subacl_size(trees->trees[s], fname, &size, &count)) return rc;
        if (!size) continue;
        if (int32_t rc = write_subacl(trees->trees[s], w, size, count, fname)) return rc;
    }
    return 0;
}

int32_t bad_structure(int line) {
    return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_CORRUPTED, "security/ACL/lib/ryacl_acl", line);
}

}  // namespace

int32_t sec__acltree_to_subacl(sec_acltree_s *tree, unsigned char **subacl, size_t *sublen) {
    const char *fname = "sec__acltree_to_subacl";
    if (!subacl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, fname, 2, 0);
    *subacl = nullptr;
    if (sublen) *sublen = 0;
    size_t size = 0, count = 0;
    if (int32_t rc = subacl_size(tree, fname, &size, &count)) return rc;
    if (size == 0) return 0;
    auto *block = static_cast<unsigned char *>(acl__malloc(size));
    if (!block) return acl__no_memory(fname, size_arg(size));
    writer w{block, block, size};
    if (int32_t rc = write_subacl(tree, &w, size, count, fname)) {
        std::free(block);
        return rc;
    }
    *subacl = block;
    if (sublen) *sublen = size;
    return 0;
}

int32_t sec__acltrees_to_acl(const acl__trees_s *trees, sec_acl_buffer_t acl) {
    const char *fname = "sec__acltrees_to_acl";
    if (!acl) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, fname, 2, 0);
    acl->length = 0;
    acl->value = nullptr;
    acl__acl_plan plan{};
    if (int32_t rc = acltrees_size(trees, fname, &plan)) return rc;
    const size_t total = plan.total;
    auto *buf = static_cast<unsigned char *>(acl__malloc(total));
    if (!buf) return acl__no_memory(fname, size_arg(total));
    acl__advise_large(buf, total);
    writer w{buf, buf, total};
    if (int32_t rc = write_acltrees(trees, plan.nsub, &w, fname)) {
        std::free(buf);
        return rc;
    }
    acl->length = static_cast<int32_t>(total);
    acl->value = buf;
    return 0;
}

int32_t acl__acltrees_size(const acl__trees_s *trees, acl__acl_plan *plan) {
    *plan = {};
    return acltrees_size(trees, "sec__acltrees_to_acl", plan);
}

int32_t acl__acltrees_emit(const acl__trees_s *trees, const acl__acl_plan &plan, const acl__byte_sink *sink) {
    const char *fname = "sec__acltrees_to_acl";
    // One record (at most a 7-byte header and a 65535-byte identifier field)
    // always fits; a quarter of a megabyte keeps the writes few and the
    // staging area in cache.
    constexpr size_t kStage = size_t{256} << 10;
    static_assert(kStage >= ACL_ENTRY_HDR_SIZE + ACL_MAX_IDLEN + 1);
    auto *stage = static_cast<unsigned char *>(acl__malloc(kStage));
    if (!stage) return acl__no_memory(fname, size_arg(kStage));
    writer w{stage, stage, kStage, sink, kStage};
    int32_t rc = write_acltrees(trees, plan.nsub, &w, fname);
    if (rc == 0) rc = w.flush();
    if (rc == 0 && w.written != plan.total) rc = acl::set_error(ACL_RC_INTERNAL, acl::msg::INTERNAL, ACL_LOC_ACL, 0);
    std::free(stage);
    return rc;
}

// Every refusal below is of a sub-ACL that did not come from this
// library's writers; validation would have reported the same faults:
//  - structure running past `avail` (header, mechanism, an entry header or
//    identifier cut off): 42 with message 97, the corrupted-buffer message;
//  - a type that is none of the five: 42 with message 107;
//  - a type 1 or 2 sub-ACL counting more than one entry: 42 with message 98;
//  - a mechanism length field outside 2 to 17 for types 4 and 8 (it could
//    not fit the entry record's 17-byte field): 42 with message 110;
//  - a mechanism whose text and length disagree: 42 with message 111;
//  - an identifier of types 4, 8 or 16 whose length field is 0 or whose
//    text does not end exactly at its length: 43 with message 114.
// Entry versions are not looked at, as before.
int32_t sec__subacl_to_acltree(const unsigned char *p, size_t avail, sec_acltree_t *tree, size_t *used) {
    if (!tree) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__subacl_to_acltree", 3, 0);
    *tree = nullptr;
    if (!p) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__subacl_to_acltree", 1, 0);
    if (avail < ACL_SUBACL_HDR_SIZE) return bad_structure(__LINE__);
    const acl__subacl s = acl__subacl_alone(p, avail);
    const unsigned char type = s.type;
    const size_t mechlen = s.mechlen;
    if (!acl__valid_type(type)) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_SUBACL_TYPE, type, ACL_LOC_ACL);
    if ((type == SEC_ACLE_TYPE_UNAUTHENTICATED || type == SEC_ACLE_TYPE_ANYOTHER) && s.count > 1)
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::SINGLE_ACLE_REPEATED);
    if (!s.header_fits()) return bad_structure(__LINE__);
    char mech[kMechField] = {};
    const bool with_mech = acl__type_has_mech(type);
    if (with_mech) {
        if (mechlen < 2 || mechlen > kMechField)
            return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_SUBACL_MECH_LENGTH, static_cast<int>(mechlen), ACL_LOC_ACL);
        std::memcpy(mech, p + ACL_SUBACL_HDR_SIZE, mechlen - 1);
        if (std::strlen(mech) != mechlen - 1 || p[ACL_SUBACL_HDR_SIZE + mechlen - 1] != '\0')
            return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_SUBACL_MECH, mech, ACL_LOC_ACL);
    }
    // Types 1, 2 and 16 carry no mechanism; a length field there is skipped
    // over, as the entries are located after it.
    const bool with_id = acl__type_has_id(type);
    const size_t sublen = s.length;
    const size_t bound = sublen < avail ? sublen : avail;  // only a sizing hint
    acl__entry_cursor<> entries(p, s, avail);
    acl__entry e;
    sec_acltree_t t = nullptr;
    int32_t rc = 0;
    for (int r; (r = entries.next(&e)) != 0;) {
        if (r < 0) {
            rc = bad_structure(__LINE__);
            break;
        }
        const size_t idlen = e.idlen;
        if (with_id && (idlen == 0 || std::memchr(e.id, '\0', idlen) != e.id + idlen - 1)) {
            rc = acl::set_error(ACL_RC_BAD_ACLE, acl::msg::ACLE_ID_LENGTH, ACL_LOC_ACL);
            break;
        }
        // A sub-ACL holding one identifier twice keeps the later permission.
        rc = acl__tree_insert(&t, 0, type, e.perm, mech, with_mech ? mechlen - 1 : 0, with_id ? e.id : "",
                              with_id ? idlen - 1 : 0);
        if (rc) break;
        if (e.off == s.entries() && s.count > 1) {
            // Grow once.  The counts may lie, so the room asked for is what
            // the bytes present could hold, not what the header claims.
            const size_t pos = entries.pos();
            size_t rest = bound > pos ? bound - pos : 0;
            size_t more = rest / (ACL_ENTRY_HDR_SIZE + (with_id ? 1 : 0));
            if (more > s.count - 1) more = s.count - 1;
            rc = acl__tree_reserve(&t, more, rest);
            if (rc) break;
        }
    }
    if (rc) {
        sec__free_acltree(t);
        return rc;
    }
    *tree = t;
    if (used) *used = entries.pos();
    return 0;
}

bool acl__find_subacl(const sec_acl_buffer_desc *acl, unsigned char type, const char *mech,
                      acl__subacl *found) {
    if (!acl || !acl->value || acl->length < ACL_HDR_SIZE) return false;
    const auto *p = static_cast<const unsigned char *>(acl->value);
    const bool by_mech = acl__type_has_mech(type);
    // Without a mechanism a user or expanded sub-ACL cannot be named.
    if (by_mech && !mech) return false;
    acl__subacl_cursor<> subs(p, static_cast<size_t>(acl->length));
    acl__subacl s;
    // A sub-ACL that cannot be located ends the search: nothing behind it
    // can be either.
    while (subs.next(&s) == 1) {
        if (s.type != type) continue;
        const size_t mlen = s.mechlen;
        if (!by_mech || (mlen >= 1 && mlen <= kMechField && s.header_fits() &&
                         p[s.off + ACL_SUBACL_HDR_SIZE + mlen - 1] == '\0' &&
                         zo_strcasecmp_posix_1(mech, reinterpret_cast<const char *>(p + s.off + ACL_SUBACL_HDR_SIZE)) == 0)) {
            *found = s;
            return true;
        }
    }
    return false;
}

int32_t sec__find_subacl(const sec_acl_buffer_desc *acl, unsigned char type, const char *mech,
                         unsigned char **subacl) {
    if (!subacl) return 0;
    acl__subacl s;
    *subacl = acl__find_subacl(acl, type, mech, &s) ? static_cast<unsigned char *>(acl->value) + s.off : nullptr;
    return 0;
}
