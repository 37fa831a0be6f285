// A sequence of operations on one compiled ACL, decoded from the input:
// add, add2, delete, list, list by type, single and group evaluation, with
// now and then one allocation made to fail and the direct edit of sorted
// sub-ACLs switched off.  A plain model of the ACL's entries is kept beside
// it; after every step the buffer must be byte for byte the model compiled,
// and every result must be the one the model gives.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "fuzz_model.h"
#include "ry_zo.h"
#include "ryacl.h"
#include "ryacl_acl_edit.h"
#include "ryacl_alloc.h"

namespace {

using namespace fuzzmodel;

class input {
public:
    input(const uint8_t *p, size_t n) : p_(p), n_(n) {}
    bool empty() const { return n_ == 0; }
    uint8_t u8() {
        if (!n_) return 0;
        --n_;
        return *p_++;
    }
    uint32_t u32() {
        uint32_t v = 0;
        for (int i = 0; i < 4; ++i) v |= static_cast<uint32_t>(u8()) << (8 * i);
        return v;
    }
    // Up to `max` bytes of text: a NUL would end it early, so it becomes
    // `nul_as`.
    std::string text(size_t len, char nul_as) {
        std::string s;
        for (size_t i = 0; i < len && n_; ++i) {
            char c = static_cast<char>(u8());
            s.push_back(c ? c : nul_as);
        }
        return s;
    }

private:
    const uint8_t *p_;
    size_t n_;
};

const char *const kMechs[] = {"unix", "UNIX", "Unix", "krb5", "KRB5", "hnd", "HND", "exp", "x", "abcdefghijklmnop"};
const char *const kIds[] = {"alice", "Alice", "ALICE", "bob",  "Bob", "carol", "a", "A", "b", "z", "Z", "",
                            "@",     "alice@node1", "\xc3\xa9t\xc3\xa9", "\x7f\xff", "[", "_"};
constexpr size_t kNMechs = sizeof kMechs / sizeof *kMechs;
constexpr size_t kNIds = sizeof kIds / sizeof *kIds;

std::string pick_mech(input &in) {
    const uint8_t k = in.u8();
    if (k >= 0xf8) {
        std::string m = in.text(1 + in.u8() % 16, 'm');
        return m.empty() ? "m" : m;
    }
    return kMechs[k % kNMechs];
}
std::string pick_id(input &in) {
    const uint8_t k = in.u8();
    if (k >= 0xf0) return in.text(in.u8() % 24, '\x01');
    return kIds[k % kNIds];
}

// User handler for "hnd": exact, case-sensitive order.  Expanded handler
// for "exp": case-insensitive equality.
int32_t user_handler(const char *client, const char *entry) {
    int c = std::strcmp(client, entry);
    return c < 0 ? -1 : c > 0;
}
int32_t expanded_handler(const char *client, const char *entry) {
    return folded(client) == folded(entry) ? 0 : 1;
}

// One allocation may be made to fail: the n-th from the arming on.
long g_allocs = 0, g_fail_at = 0;
bool alloc_hook(size_t) { return ++g_allocs != g_fail_at; }
bool failure_reached() { return g_fail_at && g_allocs >= g_fail_at; }

struct state {
    acl model;           // sub-ACLs in buffer order
    bool present = false;  // the descriptor holds a compiled ACL
    sec_buffer_desc buf{0, nullptr};

    std::vector<unsigned char> expected() const { return compile(model, in_order(model)); }
    void check_buffer() {
        if (!present) {
            FUZZ_CHECK(buf.length == 0 && buf.value == nullptr);
            return;
        }
        FUZZ_CHECK(same_bytes(buf, expected()));
        FUZZ_CHECK(sec_convert_acl_to_host(1, &buf) == 0);
    }
};

bool valid_type(unsigned t) { return t == 1 || t == 2 || t == 4 || t == 8 || t == 16; }

void do_add(state &st, input &in, bool noupdate) {
    static const unsigned char types[] = {1, 2, 4, 8, 16, 4, 16, 3};
    sec_acle_desc d{};
    d.type = types[in.u8() % 8];
    const std::string mech = pick_mech(in), id = pick_id(in);
    std::memcpy(d.mech, mech.c_str(), mech.size());
    d.perm = in.u32();
    d.id = const_cast<char *>(id.c_str());
    const int32_t rc = noupdate ? sec_add_acle_to_acl2(&d, &st.buf) : sec_add_acle_to_acl(&d, &st.buf);
    if (failure_reached()) {
        FUZZ_CHECK(rc == ACL_RC_NO_MEMORY && current_msgnum() == 89);
        return;
    }
    if (!valid_type(d.type)) {
        FUZZ_CHECK(rc == ACL_RC_BAD_ACLE && current_msgnum() == 103);
        return;
    }
    const std::string smech = has_mech(d.type) ? mech : "";
    subacl *s = st.model.find(d.type, smech);
    entry *old = s ? s->find(id) : nullptr;
    if (noupdate && old) {
        const int32_t msg = current_msgnum();
        FUZZ_CHECK(rc == ACL_RC_BAD_ACLE && (msg == 160 || msg == 144 || msg == 161));
        return;
    }
    FUZZ_CHECK(rc == 0);
    st.present = true;
    if (old) old->perm = d.perm;
    else if (s) s->entries.emplace_back(has_id(d.type) ? id : "", d.perm);
    else st.model.subs.push_back(subacl{d.type, smech, {entry(has_id(d.type) ? id : "", d.perm)}});
}

void do_delete(state &st, input &in) {
    static const unsigned char types[] = {1, 2, 4, 8, 16, 4, 16, 0x40};
    sec_acle_desc d{};
    d.type = types[in.u8() % 8];
    const std::string mech = pick_mech(in), id = pick_id(in);
    std::memcpy(d.mech, mech.c_str(), mech.size());
    d.perm = in.u32();  // plays no part
    d.id = const_cast<char *>(id.c_str());
    const std::vector<unsigned char> before = st.present ? st.expected() : std::vector<unsigned char>{};
    const int32_t rc = sec_del_acle_from_acl(&d, &st.buf);

    subacl *s = valid_type(d.type) && st.present ? st.model.find(d.type, has_mech(d.type) ? mech : "") : nullptr;
    entry *old = s ? s->find(id) : nullptr;
    if (failure_reached()) {
        FUZZ_CHECK(rc == ACL_RC_NO_MEMORY && current_msgnum() == 89);
        // Only a block that could not shrink may leave the edit done.
        if (same_bytes(st.buf, before)) return;
        FUZZ_CHECK(old != nullptr);
    } else if (!valid_type(d.type)) {
        FUZZ_CHECK(rc == ACL_RC_BAD_ACLE && current_msgnum() == 103);
        return;
    } else if (!st.present) {
        FUZZ_CHECK(rc == ACL_RC_BAD_ACL && current_msgnum() == 93);
        return;
    } else if (!old) {
        FUZZ_CHECK(rc == ACL_RC_NO_MATCH && current_msgnum() == 105);
        return;
    } else {
        FUZZ_CHECK(rc == 0);
    }
    s->entries.erase(s->entries.begin() + (old - s->entries.data()));
    if (s->entries.empty()) st.model.subs.erase(st.model.subs.begin() + (s - st.model.subs.data()));
}

void do_list(state &st, input &in, bool by_type) {
    static const unsigned char types[] = {1, 2, 4, 8, 16, 4, 8, 5};
    const unsigned char t = types[in.u8() % 8];
    const bool with_mech = in.u8() & 1;
    const std::string mech = pick_mech(in);
    sec_acle_list_desc list{7, nullptr};
    const int32_t rc = by_type ? sec_list_acl_by_type(&st.buf, t, with_mech ? mech.c_str() : nullptr, &list)
                               : sec_list_acl(&st.buf, &list);
    if (failure_reached()) {
        FUZZ_CHECK(rc == ACL_RC_NO_MEMORY && current_msgnum() == 89);
        FUZZ_CHECK(list.count == 0 && list.acles == nullptr);
        return;
    }
    if (by_type && !valid_type(t)) {
        FUZZ_CHECK(rc == ACL_RC_BAD_ARGS && current_msgnum() == 88);
        return;
    }
    FUZZ_CHECK(rc == 0);
    std::vector<listed> want;
    if (st.present) {
        if (!by_type || (has_mech(t) && !with_mech)) {
            for (const subacl &s : st.model.subs)
                if (!by_type || s.type == t) append_listed(s, want);
        } else if (subacl *s = st.model.find(t, has_mech(t) ? mech : "")) {
            append_listed(*s, want);
        }
    }
    FUZZ_CHECK(read_list(list) == want);
    sec_release_aclelist(&list);
}

// The walk of a user or expanded sub-ACL: entries in buffer order, the
// first comparison of 0 matches, a negative one ends an ordered walk.
template <class Cmp>
int32_t walk(const subacl &s, bool ordered, Cmp cmp, uint32_t *perm) {
    std::vector<const entry *> v = s.ordered();
    for (const entry *e : v) {
        const int c = cmp(e->id);
        if (c == 0) {
            *perm = e->perm;
            return 0;
        }
        if (c < 0 && ordered) break;
    }
    return ACL_RC_BAD_ACLE;
}

void do_single(state &st, input &in) {
    static const unsigned char types[] = {1, 2, 4, 8, 0x84, 0x88, 0xe4, 3, 16, 4};
    const unsigned char t = types[in.u8() % 10];
    const uint8_t z = in.u8();
    const std::string mech = pick_mech(in), zmech = pick_mech(in), id = pick_id(in);
    uint32_t perm = 0xdeadbeef;
    const int32_t rc = sec__single_acle_perm(&st.buf, t, mech.c_str(), z & 1 ? zmech.c_str() : nullptr, id.c_str(), &perm);

    const unsigned at = t & 0x1fu;
    const bool named = at == 4 || at == 8;
    int32_t want_rc = 0;
    uint32_t want = 0xdeadbeef;
    if (!st.present) want_rc = ACL_RC_BAD_ACL;
    else if (at != 1 && at != 2 && !named) want_rc = ACL_RC_BAD_ARGS;
    else if (named && id.empty()) want_rc = ACL_RC_BAD_ARGS;
    else {
        want = 0;
        const subacl *s = st.model.find(static_cast<unsigned char>(at), named ? (z & 1 ? zmech : mech) : "");
        if (!s) {
            want_rc = ACL_RC_BAD_ACLE;
        } else if (!named) {
            want = s->entries.at(0).perm;
        } else if (at == 8) {
            want_rc = folded(mech) == "exp"
                          ? walk(*s, false, [&](const std::string &e) { return expanded_handler(id.c_str(), e.c_str()); }, &want)
                          : ACL_RC_BAD_ACLE;
        } else if ((t & 0x80) && folded(mech) == "hnd") {
            want_rc = walk(*s, true, [&](const std::string &e) { return user_handler(id.c_str(), e.c_str()); }, &want);
        } else {
            want_rc = walk(*s, true, [&](const std::string &e) { return folded(id).compare(folded(e)); }, &want);
        }
        if (want_rc) want = 0;
    }
    FUZZ_CHECK(rc == want_rc && perm == want);
}

void do_groups(state &st, input &in) {
    const uint8_t k = in.u8();
    int32_t count = k % 5 == 4 ? -1 : k % 5;
    std::vector<std::string> names;
    for (int32_t i = 0; i < count; ++i) names.push_back(pick_id(in));
    std::vector<sec_buffer_desc> groups;
    for (const std::string &n : names) groups.push_back({0, const_cast<char *>(n.c_str())});
    sec_buffer_desc none{0, nullptr};
    uint32_t perm = 0xdeadbeef;
    const int32_t rc = sec__group_acles_perm(&st.buf, count, groups.empty() ? &none : groups.data(), &perm);

    int32_t want_rc = 0;
    uint32_t want = 0;
    if (!st.present) {
        want_rc = ACL_RC_BAD_ACL;
        want = 0xdeadbeef;
    } else if (count != 0) {
        bool matched = false;
        if (subacl *s = st.model.find(SEC_ACLE_TYPE_GROUP, ""))
            for (const std::string &n : names)
                if (entry *e = s->find(n)) {
                    want |= e->perm;
                    matched = true;
                }
        if (!matched) {
            want_rc = ACL_RC_BAD_ACLE;
            want = 0;
        }
    }
    FUZZ_CHECK(rc == want_rc && perm == want);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    static bool registered = [] {
        return sec__register_id_handler(SEC_ID_HANDLER_USER, "hnd", user_handler) == 0 &&
               sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "exp", expanded_handler) == 0;
    }();
    FUZZ_CHECK(registered);
    quiet_library_streams();

    input in(data, size);
    state st;
    acl__edit_direct_enabled = true;
    if (in.u8() & 1) {
        FUZZ_CHECK(sec_create_empty_acl(&st.buf) == 0);
        st.present = true;
    }
    for (int ops = 0; ops < 512 && !in.empty(); ++ops) {
        const uint8_t op = in.u8();
        g_allocs = 0;
        if (op >= 0xe0) {
            // The next operation meets one failing allocation.
            g_fail_at = 1 + op % 8;
            acl__set_alloc_hook(alloc_hook);
        }
        switch (op % 8) {
        case 0: do_add(st, in, false); break;
        case 1: do_add(st, in, true); break;
        case 2: do_delete(st, in); break;
        case 3: do_list(st, in, false); break;
        case 4: do_list(st, in, true); break;
        case 5: do_single(st, in); break;
        case 6: do_groups(st, in); break;
        default: acl__edit_direct_enabled = !acl__edit_direct_enabled; break;
        }
        acl__set_alloc_hook(nullptr);
        g_fail_at = 0;
        st.check_buffer();
    }
    acl__edit_direct_enabled = true;
    if (st.present) FUZZ_CHECK(sec_release_acl(&st.buf) == 0);
    return 0;
}
