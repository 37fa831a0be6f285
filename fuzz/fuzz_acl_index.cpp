// Indexed evaluation against the walk, on any bytes.  Input: four knob bytes
// that pick the queries, then the ACL's bytes.
//
// Creating an index must refuse exactly what conversion with verification
// refuses, with the same record (and a buffer in the other byte order with
// message 102).  An index that was made must answer every query exactly as
// the walk does on the bytes it was made from: return code, mask, formatted
// error record, and the identity handlers' calls in the same order.  The
// bytes handed to creation are overwritten and freed before any query, so
// an index that kept a pointer into them is caught by the sanitizers or by
// a wrong answer.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "fuzz_model.h"
#include "ry_zo.h"
#include "ryacl.h"

namespace {

using namespace fuzzmodel;
using bytes = std::vector<unsigned char>;

std::string current_text() {
    zo_error_t *rec = nullptr;
    zo_get_error_1(&rec);
    if (!rec) return "";
    char *text = nullptr;
    zo_get_errmsg_1(rec, &text);
    std::string s = text ? text : "";
    zo_rel_errmsg_1(text);
    zo_rel_error_1(rec);
    return s;
}

// The handlers note every entry they are shown and leave an error record
// of their own, which must never reach the caller.  Their answers follow
// the folded comparison but for identifiers that begin with a digit, where
// they answer the other way round: a walk through out-of-order answers.
std::string g_calls;
int32_t noted(char tag, const char *client, const char *entry) {
    g_calls += tag;
    g_calls += entry;
    g_calls += ';';
    zo_set_error_1(ACL_RC_INTERNAL, nullptr, "ryseclib.cat", 1, 91, "handler %1$s\n", "x");
    const int c = folded(client).compare(folded(entry));
    const int sign = c < 0 ? -1 : c > 0;
    return entry[0] >= '0' && entry[0] <= '9' ? -sign : sign;
}
int32_t user_handler(const char *client, const char *entry) { return noted('u', client, entry); }
int32_t expanded_handler(const char *client, const char *entry) { return noted('e', client, entry); }

// At the first input, not during static initialisation: the library's
// state may not be constructed yet.
bool registered() {
    static const bool done = sec__register_id_handler(SEC_ID_HANDLER_USER, "unix", user_handler) == 0 &&
                             sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "unix", expanded_handler) == 0 &&
                             sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "KRB5", expanded_handler) == 0;
    return done;
}

// "code perm calls|text" of one evaluation, the walk's or the index's.
struct outcome {
    int32_t rc;
    uint32_t perm;
    std::string calls, text;
    bool operator==(const outcome &o) const {
        return rc == o.rc && perm == o.perm && calls == o.calls && text == o.text;
    }
};
// A refused parameter names the operation refused; the index's operations
// are named in place of the walk's.  A mechanism or identity from the input
// may spell an operation's name too, so both sides' texts are mapped alike.
template <class F>
outcome run(F f, const char *name, const char *as) {
    g_calls.clear();
    uint32_t perm = 0xdeadbeef;
    const int32_t rc = f(&perm);
    std::string text = current_text();
    for (size_t at = 0; (at = text.find(name, at)) != std::string::npos; at += std::strlen(as))
        text.replace(at, std::strlen(name), as);
    return {rc, perm, g_calls, text};
}

// Texts to ask for: what the buffer seems to hold (walked by its lengths,
// every read bounded), the same in upper case, and a few that order before
// and after anything.
struct candidates {
    std::vector<std::string> ids{"a", "zzzz", "\xff", "0"};
    std::vector<std::string> mechs{"unix", "KRB5"};
};

std::string upper(std::string s) {
    for (char &c : s)
        if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 32);
    return s;
}

std::string text_at(const bytes &b, size_t pos, size_t max) {
    const char *p = reinterpret_cast<const char *>(&b[pos]);
    return std::string(p, strnlen(p, max));
}

void gather(const bytes &b, candidates &c) {
    if (b.size() < 5) return;
    size_t pos = 5;
    for (int s = 0; s < 8 && b.size() - pos >= 10; ++s) {
        const size_t len = static_cast<size_t>(b[pos]) | static_cast<size_t>(b[pos + 1]) << 8 |
                           static_cast<size_t>(b[pos + 2]) << 16 | static_cast<size_t>(b[pos + 3]) << 24;
        const size_t mlen = b[pos + 9];
        if (mlen && b.size() - pos - 10 >= mlen) {
            const std::string m = text_at(b, pos + 10, mlen);
            if (!m.empty()) c.mechs.insert(c.mechs.end(), {m, upper(m)});
        }
        size_t e = pos + 10 + mlen;
        for (int k = 0; k < 6 && e < b.size() && b.size() - e >= 7; ++k) {
            const size_t idlen = static_cast<size_t>(b[e + 5]) | static_cast<size_t>(b[e + 6]) << 8;
            if (idlen > b.size() - e - 7) break;
            const std::string id = text_at(b, e + 7, idlen);
            if (!id.empty()) c.ids.insert(c.ids.end(), {id, upper(id), id + "~"});
            e += 7 + idlen;
        }
        if (len < 10 || len > b.size() - pos) break;
        pos += len;
    }
}

void compare_queries(const sec_buffer_desc &acl, sec_acl_index_t ix, const unsigned char kn[4], const bytes &start) {
    candidates cand;
    gather(start, cand);
    sec_buffer_desc *a = const_cast<sec_buffer_desc *>(&acl);
    const size_t nids = cand.ids.size() < 24 ? cand.ids.size() : 24;
    for (unsigned char t : {1, 2, 4, 8, 0x84, 0x88, 0x24, 16, 3}) {
        for (size_t m = 0; m < cand.mechs.size(); ++m) {
            const char *mech = cand.mechs[m].c_str();
            // zmech: none, or another candidate chosen by the knobs.
            const char *zmech = (kn[0] >> (m % 8)) & 1 ? cand.mechs[(m + kn[1]) % cand.mechs.size()].c_str() : nullptr;
            for (size_t i = 0; i < nids; ++i) {
                const char *id = cand.ids[i].c_str();
                const outcome walk = run([&](uint32_t *p) { return sec__single_acle_perm(a, t, mech, zmech, id, p); },
                                         "sec_index_single_acle_perm", "sec__single_acle_perm");
                const outcome idx = run([&](uint32_t *p) { return sec_index_single_acle_perm(ix, t, mech, zmech, id, p); },
                                        "sec_index_single_acle_perm", "sec__single_acle_perm");
                if (!(walk == idx)) std::fprintf(report_stream(), "t=%d mech=%s zmech=%s id=%s: walk %d %u %s / idx %d %u %s\n%s\n%s\n", t, mech, zmech ? zmech : "-", id, walk.rc, walk.perm, walk.calls.c_str(), idx.rc, idx.perm, idx.calls.c_str(), walk.text.c_str(), idx.text.c_str());
                FUZZ_CHECK(walk == idx);
                if ((t & 0x1f) != 4 && (t & 0x1f) != 8) break;
            }
        }
    }
    // Group names: a run of candidates from a knob-chosen start, repeated
    // names included, and a negative count now and then.
    for (int round = 0; round < 6; ++round) {
        std::vector<sec_buffer_desc> g;
        const size_t n = (kn[2] >> round) % 5;
        for (size_t k = 0; k < n; ++k)
            g.push_back({0, const_cast<char *>(cand.ids[(kn[3] + round * 7 + k * k) % cand.ids.size()].c_str())});
        const int32_t count = round == 5 && (kn[3] & 1) ? -1 : static_cast<int32_t>(g.size());
        const outcome walk = run([&](uint32_t *p) { return sec__group_acles_perm(a, count, g.data(), p); },
                                 "sec_index_group_acles_perm", "sec__group_acles_perm");
        const outcome idx = run([&](uint32_t *p) { return sec_index_group_acles_perm(ix, count, g.data(), p); },
                                    "sec_index_group_acles_perm", "sec__group_acles_perm");
        FUZZ_CHECK(walk == idx);
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size < 4 || size > (1u << 16)) return 0;
    quiet_library_streams();
    FUZZ_CHECK(registered());
    unsigned char kn[4];
    std::memcpy(kn, data, 4);
    const bytes original(data + 4, data + size);
    const int32_t n = static_cast<int32_t>(original.size());

    // What conversion with verification says of the same bytes.
    sec_buffer_desc conv = {0, nullptr};
    if (n > 0) FUZZ_CHECK(sec_read_acl_from_data(n, original.data(), &conv) == 0);
    const bool foreign = n >= 5 && original[0] == 0x85 && original[1] == 1 && original[2] != 2;
    const int32_t crc = foreign ? ACL_RC_BAD_ACL : sec_convert_acl_to_host(1, &conv);
    const std::string ctext = foreign ? "" : current_text();
    std::free(conv.value);

    sec_buffer_desc given = {0, nullptr};
    if (n > 0) FUZZ_CHECK(sec_read_acl_from_data(n, original.data(), &given) == 0);
    sec_acl_index_t ix = reinterpret_cast<sec_acl_index_t>(&given);  // must be overwritten
    const int32_t rc = sec_create_acl_index(&given, &ix);
    FUZZ_CHECK(rc == crc);
    if (foreign) FUZZ_CHECK(current_msgnum() == 102);
    else FUZZ_CHECK(current_text() == ctext);
    FUZZ_CHECK((rc == 0) == (ix != nullptr));
    if (given.value) std::memset(given.value, 0x5a, static_cast<size_t>(n));
    std::free(given.value);
    if (rc) return 0;

    sec_buffer_desc acl = {0, nullptr};
    FUZZ_CHECK(sec_read_acl_from_data(n, original.data(), &acl) == 0);
    compare_queries(acl, ix, kn, original);
    std::free(acl.value);
    sec_release_acl_index(ix);
    return 0;
}
