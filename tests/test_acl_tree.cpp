// ACL trees: order, duplicates, deletion, moving to lists, memory failures,
// and depth independence of the input's order.
#include <gtest/gtest.h>
#include <pthread.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "ry_zo_int.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_tree.h"
#include "ryacl_test_support.h"

namespace {

sec_acle_desc entry(unsigned char type, uint32_t perm, const char *mech, const char *id) {
    sec_acle_desc e{};
    e.perm = perm;
    e.type = type;
    if (mech) std::memcpy(e.mech, mech, strnlen(mech, 16));
    e.id = const_cast<char *>(id);
    return e;
}

int32_t add(sec_acltree_t *t, unsigned char type, const std::string &id, uint32_t perm = 1,
            const char *mech = "unix", sec_boolean_t single = 1) {
    sec_acle_desc e = entry(type, perm, mech, id.c_str());
    return sec__add_acle_to_tree(single, &e, t);
}

int32_t del(sec_acltree_t t, unsigned char type, const char *id, const char *mech = "unix") {
    sec_acle_desc e = entry(type, 0, mech, id);
    return sec__del_acle_from_tree(&e, t);
}

struct seen {
    std::string mech, id;
    uint32_t perm;
};

std::vector<seen> in_order(sec_acltree_t t) {
    std::vector<seen> out;
    EXPECT_EQ(acl__tree_visit(
                  t,
                  [](const acl__tree_entry_view *e, void *ctx) {
                      static_cast<std::vector<seen> *>(ctx)->push_back(
                          {e->mech, e->id ? e->id : "<null>", e->perm});
                      return true;
                  },
                  &out),
              0);
    return out;
}

std::vector<std::string> ids(sec_acltree_t t) {
    std::vector<std::string> r;
    for (auto &s : in_order(t)) r.push_back(s.id);
    return r;
}

std::vector<std::string> expected_order(std::vector<std::string> v) {
    std::sort(v.begin(), v.end(), [](const std::string &a, const std::string &b) {
        return zo_strcasecmp_posix_1(a.c_str(), b.c_str()) < 0;
    });
    return v;
}

// Identifiers that share long prefixes, differ in case, carry bytes above
// 0x7f and end at every length: what the eight-byte keys must get right.
std::vector<std::string> awkward_ids(size_t n, unsigned seed) {
    std::mt19937 rng(seed);
    const char alphabet[] = {'a', 'A', 'b', 'B', 'z', 'Z', '_', '@', '[', '`', '0', '\x7f', '\xc3', '\xa9'};
    std::vector<std::string> out;
    std::vector<std::string> seenfold;
    while (out.size() < n) {
        std::string s = "user0000";
        size_t len = rng() % 20;
        for (size_t i = 0; i < len; ++i) s += alphabet[rng() % sizeof alphabet];
        std::string f = s;
        for (char &c : f)
            if (c >= 'A' && c <= 'Z') c = static_cast<char>(c + 32);
        if (std::find(seenfold.begin(), seenfold.end(), f) != seenfold.end()) continue;
        seenfold.push_back(f);
        out.push_back(s);
    }
    return out;
}

TEST(AclTree, UserAndGroupComeOutSortedWhateverTheInsertionOrder) {
    for (unsigned char type : {SEC_ACLE_TYPE_USER, SEC_ACLE_TYPE_GROUP}) {
        for (unsigned seed : {1u, 2u, 3u}) {
            std::vector<std::string> v = awkward_ids(3000, seed);
            sec_acltree_t t = nullptr;
            for (auto &s : v) ASSERT_EQ(add(&t, type, s), 0);
            EXPECT_EQ(ids(t), expected_order(v));
            EXPECT_EQ(acl__tree_count(t), v.size());
            sec__free_acltree(t);
        }
    }
    // Descending input, and an ascending prefix with an unsorted tail.
    std::vector<std::string> v = expected_order(awkward_ids(500, 9));
    sec_acltree_t down = nullptr, tail = nullptr;
    for (size_t i = v.size(); i-- > 0;) ASSERT_EQ(add(&down, SEC_ACLE_TYPE_USER, v[i]), 0);
    for (size_t i = 0; i < v.size(); i += 2) ASSERT_EQ(add(&tail, SEC_ACLE_TYPE_USER, v[i]), 0);
    for (size_t i = 1; i < v.size(); i += 2) ASSERT_EQ(add(&tail, SEC_ACLE_TYPE_USER, v[v.size() - i]), 0);
    EXPECT_EQ(ids(down), v);
    EXPECT_EQ(ids(tail), v);
    sec__free_acltree(down);
    sec__free_acltree(tail);

    // Expanded entries keep their insertion order.
    std::vector<std::string> x = {"zeta", "Alpha", "mid", "alphA2", "0"};
    sec_acltree_t t = nullptr;
    for (auto &s : x) ASSERT_EQ(add(&t, SEC_ACLE_TYPE_EXPANDED, s), 0);
    EXPECT_EQ(ids(t), x);
    sec__free_acltree(t);
}

TEST(AclTree, DuplicatesRefusedOrReplacedKeepingTheFirstSpelling) {
    sec_acltree_t t = nullptr;
    ASSERT_EQ(add(&t, SEC_ACLE_TYPE_USER, "Bob", 1, "unix"), 0);
    EXPECT_EQ(add(&t, SEC_ACLE_TYPE_USER, "bob", 3, "UNIX"), ACL_RC_BAD_ACLE);
    EXPECT_EQ(rytest::error_msgnum(), 144);
    EXPECT_NE(rytest::error_text().find("ACLE type: u; mechanism: UNIX; identity: bob."), std::string::npos);
    EXPECT_EQ(in_order(t)[0].perm, 1u);
    EXPECT_EQ(add(&t, SEC_ACLE_TYPE_USER, "bob", 3, "UNIX", 0), 0);
    auto r = in_order(t);
    ASSERT_EQ(r.size(), 1u);
    EXPECT_EQ(r[0].id, "Bob");
    EXPECT_EQ(r[0].mech, "unix");
    EXPECT_EQ(r[0].perm, 3u);
    sec__free_acltree(t);

    // The same once the tree has left its one-entry form.
    t = nullptr;
    ASSERT_EQ(add(&t, SEC_ACLE_TYPE_EXPANDED, "a", 1, "x") | add(&t, SEC_ACLE_TYPE_EXPANDED, "b", 1, "x"), 0);
    EXPECT_EQ(add(&t, SEC_ACLE_TYPE_EXPANDED, "B", 7, "X"), ACL_RC_BAD_ACLE);
    EXPECT_NE(rytest::error_text().find("ACLE type: e; mechanism: X; identity: B."), std::string::npos);
    EXPECT_EQ(add(&t, SEC_ACLE_TYPE_EXPANDED, "B", 7, "X", 0), 0);
    r = in_order(t);
    ASSERT_EQ(r.size(), 2u);
    EXPECT_EQ(r[1].id, "b");
    EXPECT_EQ(r[1].perm, 7u);
    sec__free_acltree(t);

    for (unsigned char type : {SEC_ACLE_TYPE_ANYOTHER, SEC_ACLE_TYPE_UNAUTHENTICATED, SEC_ACLE_TYPE_GROUP}) {
        t = nullptr;
        ASSERT_EQ(add(&t, type, "Staff", 1, nullptr), 0);
        EXPECT_EQ(add(&t, type, "staff", 2, nullptr), ACL_RC_BAD_ACLE);
        if (type == SEC_ACLE_TYPE_GROUP) {
            EXPECT_EQ(rytest::error_msgnum(), 161);
            EXPECT_NE(rytest::error_text().find("ACLE type: g; ACLE identifier: staff."), std::string::npos);
        } else {
            EXPECT_EQ(rytest::error_msgnum(), 160);
            EXPECT_NE(rytest::error_text().find(type == SEC_ACLE_TYPE_ANYOTHER ? "ACLE type: o." : "ACLE type: n."),
                      std::string::npos);
        }
        EXPECT_EQ(add(&t, type, "staff", 2, nullptr, 0), 0);
        EXPECT_EQ(acl__tree_count(t), 1u);
        EXPECT_EQ(in_order(t)[0].perm, 2u);
        sec__free_acltree(t);
    }
}

TEST(AclTrees, SlotsByFirstAppearanceAndMechanismWithoutCase) {
    acl__trees_s trees;
    sec_acle_desc e[] = {entry(SEC_ACLE_TYPE_ANYOTHER, 1, nullptr, nullptr),
                         entry(SEC_ACLE_TYPE_USER, 1, "unix", "a"),
                         entry(SEC_ACLE_TYPE_GROUP, 1, nullptr, "g"),
                         entry(SEC_ACLE_TYPE_USER, 1, "UniX", "b"),
                         entry(SEC_ACLE_TYPE_EXPANDED, 1, "unix", "a"),
                         entry(SEC_ACLE_TYPE_USER, 1, "krb", "a")};
    for (auto &x : e) ASSERT_EQ(sec__add_acle_to_trees(&x, &trees), 0);
    ASSERT_EQ(trees.nooftrees, 5);
    const unsigned char types[] = {2, 4, 16, 8, 4};
    for (int i = 0; i < 5; ++i) EXPECT_EQ(acl__tree_type(trees.trees[i]), types[i]);
    EXPECT_EQ(acl__tree_count(trees.trees[1]), 2u);
    EXPECT_STREQ(acl__tree_mech(trees.trees[4]), "krb");
    sec_acle_desc dup = entry(SEC_ACLE_TYPE_USER, 1, "UNIX", "B");
    EXPECT_EQ(sec__add_acle_to_trees(&dup, &trees), ACL_RC_BAD_ACLE);
    acl__free_trees(&trees);
    EXPECT_EQ(trees.nooftrees, 0);
    EXPECT_EQ(trees.trees, nullptr);

    // Many sub-ACLs: every lookup still finds its own slot.
    acl__trees_s many;
    for (int round = 0; round < 2; ++round)
        for (int i = 0; i < 3000; ++i) {
            std::string mech = "m" + std::to_string(i);
            if (round) mech[0] = 'M';
            std::string id = "id" + std::to_string(round);
            sec_acle_desc x = entry(SEC_ACLE_TYPE_USER, 1, mech.c_str(), id.c_str());
            ASSERT_EQ(sec__add_acle_to_trees(&x, &many), 0);
        }
    ASSERT_EQ(many.nooftrees, 3000);
    EXPECT_STREQ(acl__tree_mech(many.trees[2999]), "m2999");
    EXPECT_EQ(acl__tree_count(many.trees[1234]), 2u);
    acl__free_trees(&many);
}

TEST(AclTree, MechanismTextIsThatOfTheEarliestEntryStillPresent) {
    sec_acltree_t t = nullptr;
    ASSERT_EQ(add(&t, SEC_ACLE_TYPE_USER, "m", 1, "UNIX") | add(&t, SEC_ACLE_TYPE_USER, "a", 1, "unix") |
                  add(&t, SEC_ACLE_TYPE_USER, "z", 1, "Unix"),
              0);
    EXPECT_STREQ(acl__tree_mech(t), "UNIX");
    auto r = in_order(t);
    EXPECT_EQ(r[0].mech, "unix");
    EXPECT_EQ(r[2].mech, "Unix");
    ASSERT_EQ(del(t, SEC_ACLE_TYPE_USER, "M"), 0);
    EXPECT_STREQ(acl__tree_mech(t), "unix");
    unsigned char *sub = nullptr;
    size_t len = 0;
    ASSERT_EQ(sec__acltree_to_subacl(t, &sub, &len), 0);
    ASSERT_EQ(len, 10u + 5 + 2 * (7 + 2));
    EXPECT_EQ(std::string(reinterpret_cast<char *>(sub) + 10), "unix");
    EXPECT_EQ(acl__load_le32(sub + 5), 2u);
    std::free(sub);
    ASSERT_EQ(del(t, SEC_ACLE_TYPE_USER, "a"), 0);
    EXPECT_STREQ(acl__tree_mech(t), "Unix");
    sec__free_acltree(t);
}

TEST(AclTree, DeleteMissingEntriesAndReinsert) {
    EXPECT_EQ(del(nullptr, SEC_ACLE_TYPE_USER, "alice"), ACL_RC_NO_MATCH);
    EXPECT_EQ(rytest::error_msgnum(), 105);
    EXPECT_NE(rytest::error_text().find("type (4), the mechanism (unix), and the identifier (alice)"),
              std::string::npos);
    sec_acltree_t t = nullptr;
    ASSERT_EQ(add(&t, SEC_ACLE_TYPE_USER, "alice"), 0);
    EXPECT_EQ(del(t, SEC_ACLE_TYPE_USER, "alicf"), ACL_RC_NO_MATCH);
    EXPECT_EQ(del(t, SEC_ACLE_TYPE_USER, "ALICE"), 0);
    EXPECT_EQ(del(t, SEC_ACLE_TYPE_USER, "ALICE"), ACL_RC_NO_MATCH);
    unsigned char *sub = nullptr;
    size_t len = 1;
    EXPECT_EQ(sec__acltree_to_subacl(t, &sub, &len), 0);
    EXPECT_EQ(sub, nullptr);
    EXPECT_EQ(len, 0u);
    sec__free_acltree(t);

    // Ascending and descending trees (found without an index), then the
    // same identifier again and growth past a rehash.
    for (bool up : {true, false}) {
        t = nullptr;
        for (int i = 0; i < 200; ++i) ASSERT_EQ(add(&t, SEC_ACLE_TYPE_USER, "n" + std::to_string(up ? 1000 + i : 1199 - i)), 0);
        EXPECT_EQ(del(t, SEC_ACLE_TYPE_USER, "n10999"), ACL_RC_NO_MATCH);
        ASSERT_EQ(del(t, SEC_ACLE_TYPE_USER, "N1100"), 0);
        ASSERT_EQ(add(&t, SEC_ACLE_TYPE_USER, "n1100", 5), 0);
        EXPECT_EQ(add(&t, SEC_ACLE_TYPE_USER, "N1100"), ACL_RC_BAD_ACLE);
        for (int i = 0; i < 2000; ++i) ASSERT_EQ(add(&t, SEC_ACLE_TYPE_USER, "x" + std::to_string(i)), 0);
        EXPECT_EQ(add(&t, SEC_ACLE_TYPE_USER, "n1100"), ACL_RC_BAD_ACLE);
        EXPECT_EQ(del(t, SEC_ACLE_TYPE_USER, "n1100"), 0);
        EXPECT_EQ(del(t, SEC_ACLE_TYPE_USER, "n1100"), ACL_RC_NO_MATCH);
        EXPECT_EQ(acl__tree_count(t), 2199u);
        EXPECT_EQ(ids(t).front(), "n1000");
        sec__free_acltree(t);
    }

    // Unauthenticated and anyother: removed whatever the entry carries.
    t = nullptr;
    ASSERT_EQ(add(&t, SEC_ACLE_TYPE_ANYOTHER, "", 1, nullptr), 0);
    EXPECT_EQ(del(t, SEC_ACLE_TYPE_ANYOTHER, "someone", "junk"), 0);
    EXPECT_EQ(del(t, SEC_ACLE_TYPE_ANYOTHER, nullptr, nullptr), ACL_RC_NO_MATCH);
    EXPECT_NE(rytest::error_text().find("type (2), the mechanism (), and the identifier ()"), std::string::npos);
    ASSERT_EQ(add(&t, SEC_ACLE_TYPE_ANYOTHER, "someone", 77, "junk"), 0);
    EXPECT_EQ(in_order(t)[0].perm, 77u);
    EXPECT_EQ(in_order(t)[0].id, "<null>");
    sec__free_acltree(t);
    sec__free_acltree(nullptr);
}

TEST(AclTree, MoveToListInOrderSkippingRemoved) {
    sec_acle_list_desc list{0, nullptr};
    sec_acltree_t empty = nullptr;
    EXPECT_EQ(sec__acltree_to_aclelist(empty, &list), 0);
    EXPECT_EQ(list.count, 0);

    sec_acltree_t t = nullptr;
    for (const char *s : {"carol", "Alice", "bob", "dave"})
        ASSERT_EQ(add(&t, SEC_ACLE_TYPE_USER, s, static_cast<uint32_t>(s[1]), s[0] == 'A' ? "UNIX" : "unix"), 0);
    ASSERT_EQ(del(t, SEC_ACLE_TYPE_USER, "bob"), 0);
    ASSERT_EQ(sec__acltree_to_aclelist(t, &list), 0);
    EXPECT_EQ(acl__tree_count(t), 0u);
    sec_acltree_t gt = nullptr;
    ASSERT_EQ(add(&gt, SEC_ACLE_TYPE_GROUP, "wheel", 4, nullptr), 0);
    ASSERT_EQ(sec__acltree_to_aclelist(gt, &list), 0);
    ASSERT_EQ(list.count, 4);
    const char *want[] = {"Alice", "carol", "dave", "wheel"};
    for (int i = 0; i < 4; ++i) EXPECT_STREQ(list.acles[i]->id, want[i]);
    EXPECT_STREQ(list.acles[0]->mech, "UNIX");
    EXPECT_STREQ(list.acles[1]->mech, "unix");
    EXPECT_EQ(list.acles[1]->perm, static_cast<uint32_t>('a'));
    EXPECT_EQ(list.acles[3]->type, SEC_ACLE_TYPE_GROUP);
    EXPECT_STREQ(list.acles[3]->mech, "");
    sec_release_aclelist(&list);
    sec__free_acltree(t);
    sec__free_acltree(gt);
}

TEST(AclTree, MemoryFailuresLeaveNothingBehind) {
    std::vector<sec_acle_desc> input;
    std::vector<std::string> names;
    for (int i = 0; i < 40; ++i) names.push_back("id" + std::to_string((i * 7) % 40));
    for (int i = 0; i < 40; ++i)
        input.push_back(entry(i % 3 == 0 ? SEC_ACLE_TYPE_USER : (i % 3 == 1 ? SEC_ACLE_TYPE_GROUP : SEC_ACLE_TYPE_EXPANDED),
                              1, i % 2 ? "unix" : "krb", names[i].c_str()));
    input.push_back(entry(SEC_ACLE_TYPE_ANYOTHER, 1, nullptr, nullptr));
    long sites = rytest::for_each_alloc_failure(
        [&] {
            acl__trees_s trees;
            int32_t rc = 0;
            for (auto &e : input)
                if ((rc = sec__add_acle_to_trees(&e, &trees))) break;
            acl__free_trees(&trees);
            return rc;
        },
        [](int32_t rc, long) {
            EXPECT_EQ(rc, ACL_RC_NO_MEMORY);
            EXPECT_EQ(rytest::error_msgnum(), 89);
        });
    EXPECT_GT(sites, 10);

    // A failed insertion leaves the tree as it was: the entries before it
    // are all there, the failing one is not.
    sec_acltree_t t = nullptr;
    int added = 0;
    rytest::for_each_alloc_failure(
        [&] {
            int32_t rc = 0;
            for (added = 0; added < 60 && !(rc = add(&t, SEC_ACLE_TYPE_USER, "new" + std::to_string(added))); ++added) {
            }
            return rc;
        },
        [&](int32_t rc, long) {
            EXPECT_EQ(rc, ACL_RC_NO_MEMORY);
            EXPECT_EQ(acl__tree_count(t), 20u + static_cast<size_t>(added));
            EXPECT_EQ(del(t, SEC_ACLE_TYPE_USER, ("new" + std::to_string(added)).c_str()), ACL_RC_NO_MATCH);
            if (added) {
                EXPECT_EQ(del(t, SEC_ACLE_TYPE_USER, ("new" + std::to_string(added - 1)).c_str()), 0);
            }
        },
        [&] {
            sec__free_acltree(t);
            t = nullptr;
            for (int i = 0; i < 20; ++i) EXPECT_EQ(add(&t, SEC_ACLE_TYPE_USER, names[i]), 0);
        });
    sec__free_acltree(t);

    // Moving to a list: what was moved stays in the list and is released
    // with it.
    sec_acltree_t u = nullptr;
    sec_acle_list_desc list{0, nullptr};
    auto cleanup = [&] {
        sec_release_aclelist(&list);
        sec__free_acltree(u);
        u = nullptr;
    };
    rytest::for_each_alloc_failure(
        [&] {
            int32_t rc = sec__acltree_to_aclelist(u, &list);
            EXPECT_EQ(static_cast<size_t>(list.count) + acl__tree_count(u), 12u);
            return rc;
        },
        [](int32_t rc, long) {
            EXPECT_EQ(rc, ACL_RC_NO_MEMORY);
            EXPECT_EQ(rytest::error_msgnum(), 89);
        },
        [&] {
            cleanup();
            for (int i = 0; i < 12; ++i) EXPECT_EQ(add(&u, SEC_ACLE_TYPE_USER, "u" + std::to_string(20 - i)), 0);
        });
    EXPECT_EQ(list.count, 12);
    cleanup();
}

// A million identifiers in ascending order (the input that turns a plain
// search tree into a chain) through insertion, serialising and freeing on
// a 1 MiB stack.
TEST(AclTree, MillionSortedEntriesOnASmallStack) {
    pthread_attr_t attr;
    ASSERT_EQ(pthread_attr_init(&attr), 0);
    ASSERT_EQ(pthread_attr_setstacksize(&attr, 1 << 20), 0);
    struct result {
        int32_t rc = -1;
        int32_t length = 0;
        size_t count = 0;
    } res;
    pthread_t th;
    ASSERT_EQ(pthread_create(
                  &th, &attr,
                  [](void *p) -> void * {
                      auto *r = static_cast<result *>(p);
                      acl__trees_s trees;
                      char id[32];
                      r->rc = 0;
                      for (int i = 0; i < 1000000 && !r->rc; ++i) {
                          std::snprintf(id, sizeof id, "user%07d@host", i);
                          sec_acle_desc e{};
                          e.type = i % 2 ? SEC_ACLE_TYPE_USER : SEC_ACLE_TYPE_EXPANDED;
                          e.perm = 3;
                          std::strcpy(e.mech, "unix");
                          e.id = id;
                          r->rc = sec__add_acle_to_trees(&e, &trees);
                      }
                      sec_buffer_desc acl{0, nullptr};
                      if (!r->rc) r->rc = sec__acltrees_to_acl(&trees, &acl);
                      r->count = acl__tree_count(trees.trees[0]) + acl__tree_count(trees.trees[1]);
                      r->length = acl.length;
                      std::free(acl.value);
                      acl__free_trees(&trees);
                      return nullptr;
                  },
                  &res),
              0);
    pthread_join(th, nullptr);
    pthread_attr_destroy(&attr);
    EXPECT_EQ(res.rc, 0);
    EXPECT_EQ(res.count, 1000000u);
    EXPECT_EQ(res.length, 5 + 2 * 15 + 1000000 * (7 + 17));
}

}  // namespace
