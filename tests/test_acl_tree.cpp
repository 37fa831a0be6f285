// ACL trees: order, duplicates, deletion, memory failures, and no recursion
// as deep as the input.
#include <gtest/gtest.h>
#include <pthread.h>

#include <algorithm>
#include <random>

#include "lib_acl_bytes.h"
#include "ry_zo_int.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_tree.h"

namespace {

using namespace libtest;
using rcs = std::vector<int32_t>;  // results of calls made in order
constexpr unsigned U = SEC_ACLE_TYPE_USER, G = SEC_ACLE_TYPE_GROUP, E = SEC_ACLE_TYPE_EXPANDED,
                   O = SEC_ACLE_TYPE_ANYOTHER, N = SEC_ACLE_TYPE_UNAUTHENTICATED;

int32_t add(sec_acltree_t *t, unsigned type, const std::string &id, uint32_t perm = 1, const char *mech = "unix",
            sec_boolean_t single = 1) {
    sec_acle_desc e = entry(type, perm, mech, id.c_str());
    return sec__add_acle_to_tree(single, &e, t);
}
int32_t del(sec_acltree_t t, unsigned type, const std::string &id, const char *mech = "unix") {
    sec_acle_desc e = entry(type, 0, mech, id.c_str());
    return sec__del_acle_from_tree(&e, t);
}

// The tree as a sub-ACL; empty when it holds nothing or fails (*rc).
bytes serialised(sec_acltree_t t, int32_t *rc = nullptr) {
    unsigned char *sub = nullptr;
    size_t len = 1;
    const int32_t r = sec__acltree_to_subacl(t, &sub, &len);
    if (rc) *rc = r;
    bytes out(sub, sub + len);
    std::free(sub);
    return out;
}

bool caseless(const ent &a, const ent &b) { return zo_strcasecmp_posix_1(a.id.c_str(), b.id.c_str()) < 0; }

// Distinct entries of permission 1, shuffled, their identifiers sharing long
// prefixes, with letters of both cases among punctuation that sorts between
// them, bytes above 0x7f, and lengths across the eight-byte keys' boundaries.
std::vector<ent> awkward(size_t n, unsigned seed) {
    std::vector<ent> out;
    for (size_t i = 1; out.size() < n; ++i) {
        std::string s = "user0000";
        for (size_t k = i; k > 0; k = (k - 1) / 12) s += "aBcD_@[`0\x7f\xc3\xa9"[(k - 1) % 12];
        out.push_back({1, s + std::string(i % 17, 'z')});
    }
    std::shuffle(out.begin(), out.end(), std::mt19937(seed));
    return out;
}

// Shuffled, reversed, and ascending with an unsorted tail: built and
// serialised with each allocation failing in turn.  A failed insertion
// leaves the tree as it was; failed serialising (ordering needs memory)
// leaves nothing.
TEST(AclTree, OrderOfAnyInputThroughMemoryFailures) {
    std::vector<ent> sorted = awkward(3000, 1), tail;
    std::sort(sorted.begin(), sorted.end(), caseless);
    for (size_t i = 0; i < sorted.size(); i += 2) tail.push_back(sorted[i]);
    for (size_t i = 1; i < sorted.size(); i += 2) tail.push_back(sorted[sorted.size() - i]);
    const std::vector<ent> inputs[] = {awkward(3000, 1), {sorted.rbegin(), sorted.rend()}, tail};
    for (unsigned type : {U, G})
        for (const std::vector<ent> &v : inputs) {
            sec_acltree_t t = nullptr;
            size_t n = 0;
            bytes sub;
            auto flow = [&] {
                int32_t rc = 0;
                for (n = 0; n < v.size() && !(rc = add(&t, type, v[n].id)); ++n) {}
                return rc ? rc : (sub = serialised(t, &rc), rc);
            };
            auto check = [&](int32_t rc, long) {
                EXPECT_EQ(with_msg(rc), rc_msg(ACL_RC_NO_MEMORY, 89));
                EXPECT_TRUE(acl__tree_count(t) == n && sub.empty());
                EXPECT_EQ(n < v.size() ? del(t, type, v[n].id) : ACL_RC_NO_MATCH, ACL_RC_NO_MATCH);
            };
            EXPECT_GE(rytest::for_each_alloc_failure(flow, check, [&] { sec__free_acltree(t), t = nullptr; }), 3);
            EXPECT_EQ(sub, subacl(type, type == U ? "unix" : "", sorted));
            sec__free_acltree(t);
        }
}

// Singly a duplicate is refused; in a group insert its permission replaces
// the stored one, which keeps its spelling.  In the one-entry form and after.
TEST(AclTree, DuplicatesReplacementAndDeletion) {
    const struct { unsigned type; bool grown; int32_t msg; const char *text; } cases[] = {
        {U, false, 144, "type: u; mechanism: UNIX; identity: STAFF."}, {U, true, 144, "type: u; mechanism: UNIX;"},
        {E, true, 144, "type: e; mechanism: UNIX; identity: STAFF."}, {G, false, 161, "type: g; ACLE identifier: STAFF."},
        {G, true, 161, "type: g; ACLE identifier: STAFF."}, {O, false, 160, "type: o."}, {N, false, 160, "type: n."}};
    for (const auto &c : cases) {
        sec_acltree_t t = nullptr;
        ASSERT_EQ((c.grown ? add(&t, c.type, "aaa") : 0) + add(&t, c.type, "Staff"), 0);
        const char *mech = c.type == U || c.type == E ? "unix" : "";
        auto now = [&](uint32_t perm) {
            std::vector<ent> es{{perm, c.type < U ? "" : "Staff"}};
            if (c.grown) es.insert(es.begin(), {1, "aaa"});
            return subacl(c.type, mech, es);
        };
        EXPECT_EQ(with_msg(add(&t, c.type, "STAFF", 2, "UNIX")), rc_msg(ACL_RC_BAD_ACLE, c.msg)) << c.text;
        EXPECT_NE(rytest::error_text().find(c.text), std::string::npos) << rytest::error_text();
        EXPECT_EQ(serialised(t), now(1));
        EXPECT_EQ(add(&t, c.type, "STAFF", 2, "UNIX", 0), 0);
        EXPECT_EQ(serialised(t), now(2));
        // Deleted whatever the case and the mechanism given; an identifier one
        // byte off is another (types without one: whatever the entry carries).
        const int32_t off = c.type < U ? 0 : ACL_RC_NO_MATCH;
        EXPECT_EQ((rcs{del(t, c.type, "sTaFg", "junk"), del(t, c.type, "sTaFf", "junk"), del(t, c.type, "STAFF")}),
                  (rcs{off, ACL_RC_NO_MATCH - off, ACL_RC_NO_MATCH}));
        EXPECT_EQ(serialised(t), c.grown ? subacl(c.type, mech, {{1, "aaa"}}) : bytes{});
        sec__free_acltree(t);
    }
}

// The message names what was not found, of types that have it.
TEST(AclTree, DeleteFromSortedTreesAndReinsert) {
    EXPECT_EQ(with_msg(del(nullptr, U, "alice")), rc_msg(ACL_RC_NO_MATCH, 105));
    EXPECT_NE(rytest::error_text().find("type (4), the mechanism (unix), and the identifier (alice)"),
              std::string::npos);
    EXPECT_EQ(with_msg(del(nullptr, O, "x", "junk")), rc_msg(ACL_RC_NO_MATCH, 105));
    EXPECT_NE(rytest::error_text().find("type (2), the mechanism (), and the identifier ()"), std::string::npos);
    // Ascending and descending trees (searched without an index), then the
    // same identifier again and growth past a rehash.
    for (bool up : {true, false}) {
        sec_acltree_t t = nullptr;
        for (int i = 0; i < 200; ++i) ASSERT_EQ(add(&t, U, "n" + std::to_string(up ? 1000 + i : 1199 - i)), 0);
        EXPECT_EQ((rcs{del(t, U, "n10999"), del(t, U, "N1100"), add(&t, U, "n1100", 5), add(&t, U, "N1100")}),
                  (rcs{ACL_RC_NO_MATCH, 0, 0, ACL_RC_BAD_ACLE}));
        for (int i = 0; i < 2000; ++i) ASSERT_EQ(add(&t, U, "x" + std::to_string(i)), 0);
        EXPECT_EQ((rcs{add(&t, U, "n1100"), del(t, U, "n1100"), del(t, U, "n1100")}),
                  (rcs{ACL_RC_BAD_ACLE, 0, ACL_RC_NO_MATCH}));
        EXPECT_EQ(acl__tree_count(t), 2199u);
        EXPECT_STREQ(reinterpret_cast<const char *>(serialised(t).data() + 22), "n1000");  // the first entry
        sec__free_acltree(t);
    }
}

// Identifiers in ascending order (the input that turns a plain search tree
// into a chain) inserted, serialised and freed on a 1 MiB stack.
TEST(AclTree, SortedEntriesOnASmallStack) {
    auto run = [](void *) -> void * {
        sec_acltree_t t = nullptr;
        char id[32];
        for (int i = 0; i < 200000; ++i) {
            std::snprintf(id, sizeof id, "user%07d@host", i);
            EXPECT_EQ(add(&t, U, id), 0);
        }
        EXPECT_EQ(serialised(t).size(), 15u + 200000 * (7 + 17));
        sec__free_acltree(t);
        return nullptr;
    };
    pthread_attr_t attr;
    pthread_t th;
    ASSERT_EQ(pthread_attr_init(&attr) | pthread_attr_setstacksize(&attr, 1 << 20), 0);
    ASSERT_EQ(pthread_create(&th, &attr, run, nullptr), 0);
    pthread_join(th, nullptr);
    pthread_attr_destroy(&attr);
}

}  // namespace

namespace {

// Trees of an ACL whose duplicates are left to the ordered visit, filled
// with user entries of the given identifiers: the add that failed (or 0)
// and the compiled ACL's result.
struct deferred_run {
    int32_t add_rc = 0, compile_rc = 0, compile_msg = 0;
    bytes compiled;
};
deferred_run run_deferred(const std::vector<std::string> &ids, bool defer) {
    acl__trees_s trees;
    trees.defer_duplicates = defer;
    deferred_run r;
    for (const std::string &id : ids) {
        sec_acle_desc e = entry(U, 1, "unix", id.c_str());
        if ((r.add_rc = sec__add_acle_to_trees(&e, &trees)) != 0) break;
    }
    if (r.add_rc == 0) {
        sec_acl_buffer_desc acl{0, nullptr};
        r.compile_rc = sec__acltrees_to_acl(&trees, &acl);
        r.compile_msg = r.compile_rc ? rytest::error_msgnum() : 0;
        r.compiled.assign(static_cast<unsigned char *>(acl.value), static_cast<unsigned char *>(acl.value) + acl.length);
        std::free(acl.value);
    }
    acl__free_trees(&trees);
    return r;
}

}  // namespace

// With duplicates deferred, a twin is caught wherever the sort puts it:
// beside its twin in the sorted tail (in another case, or sharing more
// than the sort key's twelve bytes), across the merge with an ascending
// prefix, or at once while identifiers still arrive in one direction.
// Near twins (one a prefix of the other, or differing only past the key)
// are no duplicates, and what compiles is what the ordinary trees compile.
TEST(AclTree, DeferredDuplicatesAreFoundByTheOrderedVisit) {
    std::vector<std::string> shuffled;
    for (ent &e : awkward(400, 7)) shuffled.push_back(e.id);
    std::vector<std::string> ascending = shuffled;
    std::sort(ascending.begin(), ascending.end(),
              [](const std::string &a, const std::string &b) { return zo_strcasecmp_posix_1(a.c_str(), b.c_str()) < 0; });
    const std::string longp = "cn=a.name.longer.than.a.key,ou=";
    auto upper = [](std::string s) {
        for (char &c : s) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
        return s;
    };
    auto with = [](std::vector<std::string> v, size_t at, const std::string &id) {
        v.insert(v.begin() + static_cast<long>(at), id);
        return v;
    };
    std::vector<std::string> tailed = ascending;  // 300 ascending, then 100 that are not
    std::reverse(tailed.begin() + 300, tailed.end());
    std::vector<std::string> near;
    for (int k = 0; k < 40; ++k) near.push_back(longp + std::to_string(k * 7919 % 1000));
    near.push_back("abcdefghijkl");
    near.push_back("abcdefghijklm");
    near.push_back("ABCDEFGHIJK");

    struct {
        std::vector<std::string> ids;
        int32_t add_rc, compile_rc;
    } cases[] = {
        {with(shuffled, 350, upper(shuffled[20])), 0, ACL_RC_BAD_ACLE},        // in the tail, other case
        {with(tailed, 390, ascending[10]), 0, ACL_RC_BAD_ACLE},                // tail against the prefix
        {with(near, 41, upper(near[3])), 0, ACL_RC_BAD_ACLE},                  // past the key's bytes
        {with(ascending, 200, ascending[199]), ACL_RC_BAD_ACLE, 0},            // an ascending run
        {with({ascending.rbegin(), ascending.rend()}, 5, ascending[395]), ACL_RC_BAD_ACLE, 0},  // descending
        {shuffled, 0, 0},
        {tailed, 0, 0},
        {near, 0, 0},
        {{near.begin(), near.begin() + 12}, 0, 0},  // sorted by comparison: keys stay alike
    };
    for (const auto &c : cases) {
        const deferred_run got = run_deferred(c.ids, true);
        EXPECT_EQ(got.add_rc, c.add_rc);
        EXPECT_EQ(got.compile_rc, c.compile_rc);
        if (c.add_rc || c.compile_rc) {
            EXPECT_EQ(rytest::error_msgnum(), 144);
            continue;
        }
        EXPECT_EQ(got.compiled, run_deferred(c.ids, false).compiled);
        EXPECT_FALSE(got.compiled.empty());
    }
}
