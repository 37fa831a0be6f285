// Any bytes as a compiled ACL from outside.  Input: four knob bytes that
// pick the entries edited, then the ACL's bytes.
//
// Every operation that takes a compiled ACL is run on an exact-size copy
// twice: once as it came (no validation: nothing may be read or written
// outside the block, a failed edit leaves every byte as it was, a failed
// listing leaves an empty list), and once after sec_convert_acl_to_host
// with verification (an edit that succeeds keeps the ACL valid).  When the
// bytes are a well-formed ACL in host order, a plain reading of them says
// exactly what validation, listing, evaluation, the edits and the byte-order
// round trip must give.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "fuzz_model.h"
#include "ry_zo.h"
#include "ryacl.h"
#include "ryacl_acl_dump.h"

namespace {

using namespace fuzzmodel;
using bytes = std::vector<unsigned char>;

uint16_t ld16(const unsigned char *p) { return static_cast<uint16_t>(p[0] | (p[1] << 8)); }
uint32_t ld32(const unsigned char *p) {
    return static_cast<uint32_t>(p[0]) | (static_cast<uint32_t>(p[1]) << 8) | (static_cast<uint32_t>(p[2]) << 16) |
           (static_cast<uint32_t>(p[3]) << 24);
}

bytes view(const sec_buffer_desc &d) {
    const auto *p = static_cast<const unsigned char *>(d.value);
    return d.length > 0 && p ? bytes(p, p + d.length) : bytes{};
}

// ---- A plain reading of a well-formed ACL ---------------------------------

struct raw_entry {
    std::string id;
    uint32_t perm;
};
struct raw_sub {
    unsigned char type;
    std::string mech;
    std::vector<raw_entry> entries;  // as they stand in the buffer
    size_t off;                      // of the length field
};

// True when the bytes are a host-order ACL that follows every rule of
// validation: every sub-ACL but the last fills its length exactly; the last
// one's length may be anything that stays in the block, its entries read up
// to the block's end, and bytes may follow them.
bool read_wellformed(const bytes &b, std::vector<raw_sub> &subs) {
    subs.clear();
    const size_t n = b.size();
    if (n < 5 || b[0] != 0x85 || b[1] != 1 || b[2] != 2) return false;
    const unsigned nsub = ld16(&b[3]);
    size_t pos = 5;
    for (unsigned s = 0; s < nsub; ++s) {
        if (n - pos < 10) return false;
        const size_t start = pos, len = ld32(&b[pos]);
        const bool last = s + 1 == nsub;
        if ((!last && len < 10) || len > n - pos) return false;
        raw_sub sub{b[pos + 4], "", {}, start};
        const uint32_t count = ld32(&b[pos + 5]);
        const size_t mlen = b[pos + 9];
        const unsigned t = sub.type;
        const size_t end = last ? n : start + len;
        if (t != 1 && t != 2 && t != 4 && t != 8 && t != 16) return false;
        if (end - start - 10 < mlen) return false;
        if (has_mech(t)) {
            if (mlen < 2 || mlen > 17) return false;
            const char *m = reinterpret_cast<const char *>(&b[pos + 10]);
            if (strnlen(m, mlen) + 1 != mlen) return false;
            sub.mech = m;
        } else if (mlen != 0 || (t != 16 && count > 1)) {
            return false;
        }
        pos += 10 + mlen;
        for (uint32_t e = 0; e < count; ++e) {
            if (end - pos < 7 || b[pos] != 1) return false;
            const size_t idlen = ld16(&b[pos + 5]);
            if (end - pos - 7 < idlen) return false;
            const char *id = reinterpret_cast<const char *>(&b[pos + 7]);
            if (has_id(t) ? (idlen == 0 || strnlen(id, idlen) + 1 != idlen) : idlen != 0) return false;
            sub.entries.push_back({has_id(t) ? std::string(id) : "", ld32(&b[pos + 1])});
            pos += 7 + idlen;
        }
        if (!last && pos != end) return false;
        subs.push_back(sub);
    }
    return true;
}

// What listing shows: each sub-ACL read back with a later duplicate's
// permission replacing the earlier one.
acl listing_model(const std::vector<raw_sub> &subs) {
    acl m;
    for (const raw_sub &r : subs) {
        subacl s{r.type, r.mech, {}};
        for (const raw_entry &e : r.entries) {
            if (entry *old = s.find(e.id)) old->perm = e.perm;
            else s.entries.emplace_back(e.id, e.perm);
        }
        m.subs.push_back(s);
    }
    return m;
}

std::vector<listed> listing_of(const acl &m) {
    std::vector<listed> v;
    for (const subacl &s : m.subs) append_listed(s, v);
    return v;
}

// Byte-order reversal of a well-formed ACL, written from the layout.
bytes reversed(const bytes &b, const std::vector<raw_sub> &subs) {
    bytes r = b;
    r[2] = 1;
    std::swap(r[3], r[4]);
    for (const raw_sub &s : subs) {
        size_t p = s.off;
        std::swap(r[p], r[p + 3]);
        std::swap(r[p + 1], r[p + 2]);
        std::swap(r[p + 5], r[p + 8]);
        std::swap(r[p + 6], r[p + 7]);
        p += 10 + b[p + 9];
        for (size_t e = 0; e < s.entries.size(); ++e) {
            const size_t idlen = ld16(&b[p + 5]);
            std::swap(r[p + 1], r[p + 4]);
            std::swap(r[p + 2], r[p + 3]);
            std::swap(r[p + 5], r[p + 6]);
            p += 7 + idlen;
        }
    }
    return r;
}

// The evaluation walk over a well-formed buffer, as the entries stand.
const raw_sub *first_sub(const std::vector<raw_sub> &subs, unsigned type, const std::string &mech) {
    for (const raw_sub &s : subs)
        if (s.type == type && (!has_mech(type) || folded(s.mech) == folded(mech))) return &s;
    return nullptr;
}

int32_t expect_single(const std::vector<raw_sub> &subs, unsigned type, const std::string &mech,
                      const std::string &id, uint32_t *perm) {
    *perm = 0;
    const raw_sub *s = first_sub(subs, type, mech);
    if (!s) return ACL_RC_BAD_ACLE;
    if (type == SEC_ACLE_TYPE_UNAUTHENTICATED || type == SEC_ACLE_TYPE_ANYOTHER) {
        if (s->entries.empty()) return ACL_RC_BAD_ACLE;
        *perm = s->entries[0].perm;
        return 0;
    }
    for (const raw_entry &e : s->entries) {
        const int c = folded(id).compare(folded(e.id));
        if (c == 0) {
            *perm = e.perm;
            return 0;
        }
        if (c < 0) break;
    }
    return ACL_RC_BAD_ACLE;
}

int32_t expect_groups(const std::vector<raw_sub> &subs, const std::vector<std::string> &names, uint32_t *perm) {
    *perm = 0;
    if (names.empty()) return 0;
    const raw_sub *s = first_sub(subs, SEC_ACLE_TYPE_GROUP, "");
    if (!s) return ACL_RC_BAD_ACLE;
    bool matched = false;
    uint32_t result = 0;
    for (const std::string &n : names) {
        for (const raw_entry &e : s->entries) {
            const int c = folded(n).compare(folded(e.id));
            if (c == 0) {
                result |= e.perm;
                matched = true;
                break;
            }
            if (c < 0) break;
        }
    }
    if (!matched) return ACL_RC_BAD_ACLE;
    *perm = result;
    return 0;
}

// ---- Operations on a buffer that may be anything ----------------------------

struct knobs {
    unsigned char k[4];
};

// Candidates for identities and mechanisms: what the buffer seems to hold,
// the same in upper case, and a few that order before and after anything.
struct candidates {
    std::vector<std::string> ids{"", "A", "zzzz", "\xff"};
    std::vector<std::string> mechs{"unix", "UNIX", "krb5"};
};

std::string upper(std::string s) {
    for (char &c : s)
        if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 32);
    return s;
}

void gather(const bytes &b, candidates &c) {
    // Texts of the first few plausible sub-ACLs and entries, bounded reads.
    if (b.size() < 5) return;
    size_t pos = 5;
    for (int s = 0; s < 4 && b.size() - pos >= 10; ++s) {
        const size_t len = ld32(&b[pos]);
        const size_t mlen = b[pos + 9];
        if (mlen && b.size() - pos - 10 >= mlen) {
            std::string m(reinterpret_cast<const char *>(&b[pos + 10]), strnlen(reinterpret_cast<const char *>(&b[pos + 10]), mlen));
            if (!m.empty() && m.size() <= 16) c.mechs.push_back(m);
        }
        size_t e = pos + 10 + mlen;
        for (int k = 0; k < 4 && e < b.size() && b.size() - e >= 7; ++k) {
            const size_t idlen = ld16(&b[e + 5]);
            if (idlen > b.size() - e - 7) break;
            std::string id(reinterpret_cast<const char *>(&b[e + 7]), strnlen(reinterpret_cast<const char *>(&b[e + 7]), idlen));
            c.ids.push_back(id);
            c.ids.push_back(upper(id));
            e += 7 + idlen;
        }
        if (len < 10 || len > b.size() - pos) break;
        pos += len;
    }
}

// An entry to add or delete, chosen by the knobs among the candidates.
struct edit_entry {
    sec_acle_desc d{};
    std::string id;
};
edit_entry pick(const knobs &kn, int which, const candidates &c) {
    static const unsigned char types[] = {1, 2, 4, 8, 16};
    edit_entry e;
    const unsigned char k = kn.k[which];
    e.d.type = types[k % 5];
    const std::string &m = c.mechs[(k / 5) % c.mechs.size()];
    std::memcpy(e.d.mech, m.c_str(), std::min<size_t>(m.size(), 16));
    e.id = c.ids[(kn.k[2] + which) % c.ids.size()];
    e.d.perm = static_cast<uint32_t>(kn.k[3]) << (which * 8) | k;
    return e;
}

void check_list_result(int32_t rc, const sec_acle_list_desc &l) {
    if (rc == 0) {
        read_list(l);
    } else {
        FUZZ_CHECK(rc == ACL_RC_BAD_ACL || rc == ACL_RC_BAD_ACLE);
        FUZZ_CHECK(l.count == 0 && l.acles == nullptr);
    }
}

// Results are checked against `expected` (a reading of a well-formed
// buffer) when given, else only for their shape.
void exercise(sec_buffer_desc &buf, bool validated, const knobs &kn, const std::vector<raw_sub> *expected) {
    const bytes start = view(buf);
    candidates cand;
    gather(start, cand);

    sec_acle_list_desc list{0, nullptr};
    int32_t rc = sec_list_acl(&buf, &list);
    check_list_result(rc, list);
    if (expected) FUZZ_CHECK(rc == 0 && read_list(list) == listing_of(listing_model(*expected)));
    sec_release_aclelist(&list);
    for (unsigned char t : {1, 2, 4, 8, 16}) {
        rc = sec_list_acl_by_type(&buf, t, nullptr, &list);
        check_list_result(rc, list);
        sec_release_aclelist(&list);
        if (t == 4 || t == 8) {
            rc = sec_list_acl_by_type(&buf, t, cand.mechs.back().c_str(), &list);
            check_list_result(rc, list);
            sec_release_aclelist(&list);
        }
    }
    FUZZ_CHECK(view(buf) == start);

    sec__dump_acl(&buf);

    const size_t nids = std::min<size_t>(cand.ids.size(), 12);
    for (unsigned char t : {1, 2, 4, 8, 0x84}) {
        for (const std::string &m : {cand.mechs.front(), cand.mechs.back()}) {
            for (size_t i = 0; i < nids; ++i) {
                uint32_t perm = 0xdeadbeef;
                rc = sec__single_acle_perm(&buf, t, m.c_str(), nullptr, cand.ids[i].c_str(), &perm);
                const int32_t msg = rc ? current_msgnum() : 0;
                if (rc == ACL_RC_BAD_ARGS || msg == 96 || msg == 102 || msg == 106) FUZZ_CHECK(perm == 0xdeadbeef);
                else if (rc) FUZZ_CHECK(perm == 0 && (rc == ACL_RC_BAD_ACL || rc == ACL_RC_BAD_ACLE));
                // No handler is registered here: an expanded entry never
                // matches and the handler flag changes nothing.
                if (expected) {
                    const unsigned at = t & 0x1fu;
                    uint32_t want = 0xdeadbeef;
                    int32_t wrc = ACL_RC_BAD_ARGS;
                    if ((at != 4 && at != 8) || !cand.ids[i].empty())
                        wrc = at == 8 ? (want = 0, ACL_RC_BAD_ACLE) : expect_single(*expected, at, m, cand.ids[i], &want);
                    FUZZ_CHECK(rc == wrc && perm == want);
                }
                if (t == 1 || t == 2) break;
            }
        }
    }
    std::vector<std::string> names(cand.ids.begin(), cand.ids.begin() + static_cast<long>(std::min<size_t>(kn.k[0] % 4, nids)));
    std::vector<sec_buffer_desc> groups;
    for (const std::string &n : names) groups.push_back({0, const_cast<char *>(n.c_str())});
    uint32_t perm = 0xdeadbeef;
    rc = sec__group_acles_perm(&buf, static_cast<int32_t>(groups.size()), groups.data(), &perm);
    if (expected) {
        uint32_t want = 0;
        FUZZ_CHECK(rc == expect_groups(*expected, names, &want) && perm == want);
    }
    FUZZ_CHECK(view(buf) == start);

    // Edits.  A failure changes nothing; success keeps a valid ACL valid,
    // and on a well-formed one does exactly what the model does.
    acl model;
    if (expected) model = listing_model(*expected);
    for (int step = 0; step < 3; ++step) {
        edit_entry e = pick(kn, step == 2 ? 0 : step, cand);
        e.d.id = has_id(e.d.type) ? const_cast<char *>(e.id.c_str()) : nullptr;
        const bytes before = view(buf);
        const std::string mech = has_mech(e.d.type) ? e.d.mech : "";
        subacl *s = expected ? model.find(e.d.type, mech) : nullptr;
        entry *old = s ? s->find(e.id) : nullptr;
        if (step < 2) {
            rc = step == 0 ? sec_add_acle_to_acl(&e.d, &buf) : sec_add_acle_to_acl2(&e.d, &buf);
            if (expected) {
                const bool refused = step == 1 && old;
                FUZZ_CHECK(refused ? rc == ACL_RC_BAD_ACLE : rc == 0);
                if (old && !refused) old->perm = e.d.perm;
                else if (s && !old) s->entries.emplace_back(e.id, e.d.perm);
                else if (!s) model.subs.push_back(subacl{e.d.type, mech, {entry(e.id, e.d.perm)}});
            }
        } else {
            rc = sec_del_acle_from_acl(&e.d, &buf);
            if (expected) {
                FUZZ_CHECK(rc == (old ? 0 : s && s->entries.empty() ? ACL_RC_BAD_ACLE : ACL_RC_NO_MATCH));
                if (old) {
                    s->entries.erase(s->entries.begin() + (old - s->entries.data()));
                    if (s->entries.empty()) model.subs.erase(model.subs.begin() + (s - model.subs.data()));
                }
            }
        }
        if (rc) {
            FUZZ_CHECK(view(buf) == before);
            continue;
        }
        if (validated) {
            sec_buffer_desc copy{0, nullptr};
            const bytes now = view(buf);
            FUZZ_CHECK(sec_read_acl_from_data(static_cast<int32_t>(now.size()), now.data(), &copy) == 0);
            FUZZ_CHECK(sec_convert_acl_to_host(1, &copy) == 0);
            sec_release_acl(&copy);
        }
        if (expected) {
            FUZZ_CHECK(sec_list_acl(&buf, &list) == 0);
            FUZZ_CHECK(read_list(list) == listing_of(model));
            sec_release_aclelist(&list);
        }
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size < 5 || size > (1u << 16)) return 0;
    quiet_library_streams();
    knobs kn;
    std::memcpy(kn.k, data, 4);
    const bytes original(data + 4, data + size);
    const int32_t n = static_cast<int32_t>(original.size());

    // As it came.
    sec_buffer_desc raw{0, nullptr};
    FUZZ_CHECK(sec_read_acl_from_data(n, original.data(), &raw) == 0);
    exercise(raw, false, kn, nullptr);
    std::free(raw.value);

    // Converted and validated first.  What conversion reversed is validated
    // after it, as the reader of cache files does.
    sec_buffer_desc conv{0, nullptr};
    FUZZ_CHECK(sec_read_acl_from_data(n, original.data(), &conv) == 0);
    const bool foreign = n > 2 && original[2] != 2;
    int32_t rc = sec_convert_acl_to_host(1, &conv);
    if (rc == 0 && foreign) rc = sec_convert_acl_to_host(1, &conv);
    if (rc) FUZZ_CHECK(rc == ACL_RC_BAD_ACL || rc == ACL_RC_BAD_ACLE);
    // A conversion that failed part-way leaves bytes that are merely
    // arbitrary: they are exercised all the same.
    exercise(conv, rc == 0, kn, nullptr);
    std::free(conv.value);

    // Well-formed: validation accepts it, and both byte orders meet.
    std::vector<raw_sub> subs;
    if (read_wellformed(original, subs)) {
        sec_buffer_desc w{0, nullptr};
        FUZZ_CHECK(sec_read_acl_from_data(n, original.data(), &w) == 0);
        FUZZ_CHECK(sec_convert_acl_to_host(1, &w) == 0 && view(w) == original);
        exercise(w, true, kn, &subs);
        std::free(w.value);

        const bytes rev = reversed(original, subs);
        FUZZ_CHECK(sec_read_acl_from_data(n, rev.data(), &w) == 0);
        FUZZ_CHECK(sec_convert_acl_to_host(0, &w) == 0 && view(w) == original);
        std::free(w.value);
    }
    return 0;
}
