// The compiled ACL: the writer's bytes, reading sub-ACLs back (including
// hostile ones), finding sub-ACLs, limits and memory failures.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "ryacl_acl_buffer.h"
#include "ryacl_acl_tree.h"
#include "ryacl_test_support.h"

namespace {

using bytes = std::vector<unsigned char>;

sec_acle_desc entry(unsigned char type, uint32_t perm, const char *mech, const char *id) {
    sec_acle_desc e{};
    e.perm = perm;
    e.type = type;
    if (mech) std::memcpy(e.mech, mech, strnlen(mech, 16));
    e.id = const_cast<char *>(id);
    return e;
}

bytes compile(acl__trees_s &trees) {
    sec_buffer_desc acl{-1, reinterpret_cast<void *>(1)};
    EXPECT_EQ(sec__acltrees_to_acl(&trees, &acl), 0);
    bytes out(static_cast<unsigned char *>(acl.value), static_cast<unsigned char *>(acl.value) + acl.length);
    std::free(acl.value);
    return out;
}

// The worked example: anyother r, then users bob (r) and Alice (rw) of
// mechanism unix.
const bytes kExample = {0x85, 0x01, 0x02, 0x02, 0x00,                                      // header
                        0x27, 0x00, 0x00, 0x00, 0x04, 0x02, 0x00, 0x00, 0x00, 0x05,        // user sub-ACL
                        'u', 'n', 'i', 'x', 0x00,                                          //
                        0x01, 0x03, 0x00, 0x00, 0x00, 0x06, 0x00, 'A', 'l', 'i', 'c', 'e', 0x00,
                        0x01, 0x01, 0x00, 0x00, 0x00, 0x04, 0x00, 'b', 'o', 'b', 0x00,     //
                        0x11, 0x00, 0x00, 0x00, 0x02, 0x01, 0x00, 0x00, 0x00, 0x00,        // anyother
                        0x01, 0x01, 0x00, 0x00, 0x00, 0x00, 0x00};

TEST(AclBuffer, WorkedExampleAndEmptyAcl) {
    acl__trees_s trees;
    sec_acle_desc e[] = {entry(SEC_ACLE_TYPE_ANYOTHER, 1, nullptr, nullptr),
                         entry(SEC_ACLE_TYPE_USER, 1, "unix", "bob"),
                         entry(SEC_ACLE_TYPE_USER, 3, "unix", "Alice")};
    for (auto &x : e) ASSERT_EQ(sec__add_acle_to_trees(&x, &trees), 0);
    ASSERT_EQ(kExample.size(), 61u);
    EXPECT_EQ(compile(trees), kExample);

    // Removing every entry of a tree drops its sub-ACL and its count.
    ASSERT_EQ(sec__del_acle_from_tree(&e[0], trees.trees[0]), 0);
    bytes users = compile(trees);
    EXPECT_EQ(users.size(), 61u - 17u);
    EXPECT_EQ(users[3], 1);
    acl__free_trees(&trees);

    const bytes empty = {0x85, 0x01, 0x02, 0x00, 0x00};
    EXPECT_EQ(compile(trees), empty);
    acl__trees_s hollow;
    ASSERT_EQ(sec__add_acle_to_trees(&e[2], &hollow), 0);
    ASSERT_EQ(sec__del_acle_from_tree(&e[2], hollow.trees[0]), 0);
    EXPECT_EQ(compile(hollow), empty);
    acl__free_trees(&hollow);
}

TEST(AclBuffer, ReadBackKeepsOrderAndTakesTheLaterDuplicate) {
    // Sub-ACL of the example, read back and written again: same bytes.
    sec_acltree_t t = nullptr;
    ASSERT_EQ(sec__subacl_to_acltree(kExample.data() + 5, 39, &t), 0);
    unsigned char *sub = nullptr;
    size_t len = 0;
    ASSERT_EQ(sec__acltree_to_subacl(t, &sub, &len), 0);
    EXPECT_EQ(bytes(sub, sub + len), bytes(kExample.begin() + 5, kExample.begin() + 44));
    std::free(sub);
    // One entry added after reading back lands in order.
    sec_acle_desc b = entry(SEC_ACLE_TYPE_USER, 8, "UNIX", "BERT");
    ASSERT_EQ(sec__add_acle_to_tree(1, &b, &t), 0);
    sec_acle_list_desc list{0, nullptr};
    ASSERT_EQ(sec__acltree_to_aclelist(t, &list), 0);
    ASSERT_EQ(list.count, 3);
    EXPECT_STREQ(list.acles[1]->id, "BERT");
    EXPECT_STREQ(list.acles[1]->mech, "UNIX");
    EXPECT_STREQ(list.acles[2]->id, "bob");
    sec_release_aclelist(&list);
    sec__free_acltree(t);

    // A group sub-ACL holding "Staff" (r) then "staff" (rw).
    const bytes g = {36, 0, 0, 0, 0x10, 2, 0, 0, 0, 0, 1, 1, 0, 0, 0, 6, 0, 'S', 't', 'a', 'f', 'f', 0,
                     1,  3, 0, 0, 0, 6, 0, 's', 't', 'a', 'f', 'f', 0};
    t = nullptr;
    ASSERT_EQ(sec__subacl_to_acltree(g.data(), g.size(), &t), 0);
    ASSERT_EQ(acl__tree_count(t), 1u);
    ASSERT_EQ(sec__acltree_to_subacl(t, &sub, &len), 0);
    ASSERT_EQ(len, 10u + 13u);
    EXPECT_EQ(acl__load_le32(sub + 11), 3u);
    EXPECT_STREQ(reinterpret_cast<char *>(sub) + 17, "Staff");
    std::free(sub);
    sec__free_acltree(t);
}

TEST(AclBuffer, HostileSubaclsAreRefusedWithoutReadingPastTheBlock) {
    const bytes user(kExample.begin() + 5, kExample.begin() + 44);
    const bytes other(kExample.begin() + 44, kExample.end());
    // Every truncation: a heap copy of exactly that length, so ASan sees
    // any read past it.
    for (const bytes *src : {&user, &other})
        for (size_t n = 0; n < src->size(); ++n) {
            auto *p = static_cast<unsigned char *>(std::malloc(n ? n : 1));
            std::memcpy(p, src->data(), n);
            sec_acltree_t t = reinterpret_cast<sec_acltree_t>(1);
            int32_t rc = sec__subacl_to_acltree(p, n, &t);
            EXPECT_EQ(rc, ACL_RC_BAD_ACL) << "length " << n;
            EXPECT_EQ(rytest::error_msgnum(), 97);
            EXPECT_EQ(t, nullptr);
            std::free(p);
        }
    // Every byte replaced by a few values: refused or read, never past.
    for (size_t i = 0; i < user.size(); ++i)
        for (unsigned v : {0x00u, 0x01u, 0x12u, 0x7fu, 0xffu}) {
            bytes m = user;
            m[i] = static_cast<unsigned char>(v);
            auto *p = static_cast<unsigned char *>(std::malloc(m.size()));
            std::memcpy(p, m.data(), m.size());
            sec_acltree_t t = nullptr;
            int32_t rc = sec__subacl_to_acltree(p, m.size(), &t);
            if (rc) {
                EXPECT_EQ(t, nullptr);
            }
            sec__free_acltree(t);
            std::free(p);
        }

    // One byte changed at `at`: refused with this code and message.
    auto refused = [](bytes m, size_t at, unsigned char v, int32_t code, int32_t msg) {
        m[at] = v;
        sec_acltree_t t = nullptr;
        EXPECT_EQ(sec__subacl_to_acltree(m.data(), m.size(), &t), code) << at;
        EXPECT_EQ(rytest::error_msgnum(), msg) << at;
        EXPECT_EQ(t, nullptr);
    };
    refused(user, 9, 18, ACL_RC_BAD_ACL, 110);     // mechanism longer than its 17-byte field
    refused(user, 9, 1, ACL_RC_BAD_ACL, 110);      // empty mechanism
    refused(user, 14, 'x', ACL_RC_BAD_ACL, 111);   // mechanism without its NUL
    refused(user, 27, 'x', ACL_RC_BAD_ACLE, 114);  // "Alice" without its NUL
    refused(user, 20, 0, ACL_RC_BAD_ACLE, 114);    // identifier length 0
    refused(user, 8, 0x7f, ACL_RC_BAD_ACL, 97);    // a count that lies: the entries run out first
    refused(user, 4, 3, ACL_RC_BAD_ACL, 107);      // no such type
    refused(other, 5, 2, ACL_RC_BAD_ACL, 98);      // two anyother entries
}

TEST(AclBuffer, FindByTypeAndMechanismWithinTheLength) {
    sec_buffer_desc acl{static_cast<int32_t>(kExample.size()), const_cast<unsigned char *>(kExample.data())};
    unsigned char *sub = reinterpret_cast<unsigned char *>(1);
    EXPECT_EQ(sec__find_subacl(&acl, SEC_ACLE_TYPE_USER, "UnIx", &sub), 0);
    EXPECT_EQ(sub, kExample.data() + 5);
    sec__find_subacl(&acl, SEC_ACLE_TYPE_ANYOTHER, "whatever", &sub);
    EXPECT_EQ(sub, kExample.data() + 44);
    sec__find_subacl(&acl, SEC_ACLE_TYPE_USER, "unix2", &sub);
    EXPECT_EQ(sub, nullptr);
    sec__find_subacl(&acl, SEC_ACLE_TYPE_EXPANDED, "unix", &sub);
    EXPECT_EQ(sub, nullptr);
    sec__find_subacl(&acl, SEC_ACLE_TYPE_GROUP, "unix", &sub);
    EXPECT_EQ(sub, nullptr);

    // A length field of 0, or one past the end, stops the walk.
    bytes zero = kExample;
    zero[5] = 0;
    sec_buffer_desc z{61, zero.data()};
    sec__find_subacl(&z, SEC_ACLE_TYPE_ANYOTHER, nullptr, &sub);
    EXPECT_EQ(sub, nullptr);
    bytes past = kExample;
    past[44] = 0x12;
    sec_buffer_desc pz{61, past.data()};
    sec__find_subacl(&pz, SEC_ACLE_TYPE_ANYOTHER, nullptr, &sub);
    EXPECT_EQ(sub, nullptr);
    for (int32_t n = 0; n < 61; ++n) {  // truncated descriptors
        auto *p = static_cast<unsigned char *>(std::malloc(n ? n : 1));
        std::memcpy(p, kExample.data(), static_cast<size_t>(n));
        sec_buffer_desc d{n, p};
        sec__find_subacl(&d, SEC_ACLE_TYPE_ANYOTHER, nullptr, &sub);
        EXPECT_EQ(sub != nullptr, n == 61);
        std::free(p);
    }
    const unsigned char empty[] = {0x85, 1, 2, 0, 0};
    sec_buffer_desc e{5, const_cast<unsigned char *>(empty)};
    EXPECT_EQ(sec__find_subacl(&e, SEC_ACLE_TYPE_GROUP, nullptr, &sub), 0);
    EXPECT_EQ(sub, nullptr);
}

TEST(AclBuffer, LimitsAreRefusedNotWrapped) {
    std::string longest(65534, 'x'), over(65535, 'y');
    sec_acltree_t t = nullptr;
    sec_acle_desc a = entry(SEC_ACLE_TYPE_GROUP, 1, nullptr, longest.c_str());
    ASSERT_EQ(sec__add_acle_to_tree(1, &a, &t), 0);
    unsigned char *sub = nullptr;
    size_t len = 0;
    ASSERT_EQ(sec__acltree_to_subacl(t, &sub, &len), 0);
    EXPECT_EQ(acl__load_le16(sub + 15), 65535u);
    std::free(sub);
    sec_acle_desc b = entry(SEC_ACLE_TYPE_GROUP, 1, nullptr, over.c_str());
    ASSERT_EQ(sec__add_acle_to_tree(1, &b, &t), 0);
    EXPECT_EQ(sec__acltree_to_subacl(t, &sub, &len), ACL_RC_BAD_ACLE);
    EXPECT_EQ(rytest::error_msgnum(), 95);
    EXPECT_EQ(sub, nullptr);
    acl__trees_s trees;
    ASSERT_EQ(sec__add_acle_to_trees(&b, &trees), 0);
    sec_buffer_desc acl{7, reinterpret_cast<void *>(1)};
    EXPECT_EQ(sec__acltrees_to_acl(&trees, &acl), ACL_RC_BAD_ACLE);
    EXPECT_EQ(acl.length, 0);
    EXPECT_EQ(acl.value, nullptr);
    acl__free_trees(&trees);
    sec__free_acltree(t);

    // 65536 sub-ACLs: one too many for the 16-bit count.
    for (int i = 0; i < 65536; ++i) {
        char mech[17];
        std::snprintf(mech, sizeof mech, "m%d", i);
        sec_acle_desc e = entry(SEC_ACLE_TYPE_USER, 1, mech, "u");
        ASSERT_EQ(sec__add_acle_to_trees(&e, &trees), 0);
    }
    acl = {7, reinterpret_cast<void *>(1)};
    EXPECT_EQ(sec__acltrees_to_acl(&trees, &acl), ACL_RC_NO_MEMORY);
    EXPECT_EQ(rytest::error_msgnum(), 89);
    EXPECT_EQ(acl.value, nullptr);
    acl__free_trees(&trees);
}

TEST(AclBuffer, MemoryFailuresWhileSerialisingAndReadingBack) {
    acl__trees_s trees;
    std::vector<std::string> ids;
    for (int i = 0; i < 50; ++i) ids.push_back("id" + std::to_string((i * 17) % 50));
    for (int i = 0; i < 50; ++i) {
        sec_acle_desc e = entry(i % 2 ? SEC_ACLE_TYPE_USER : SEC_ACLE_TYPE_GROUP, 1, "unix", ids[i].c_str());
        ASSERT_EQ(sec__add_acle_to_trees(&e, &trees), 0);
    }
    bytes good = compile(trees);
    long sites = rytest::for_each_alloc_failure(
        [&] {
            sec_buffer_desc acl{9, reinterpret_cast<void *>(1)};
            int32_t rc = sec__acltrees_to_acl(&trees, &acl);
            if (rc) {
                EXPECT_EQ(acl.length, 0);
                EXPECT_EQ(acl.value, nullptr);
            } else {
                EXPECT_EQ(bytes(static_cast<unsigned char *>(acl.value),
                                static_cast<unsigned char *>(acl.value) + acl.length),
                          good);
            }
            std::free(acl.value);
            return rc;
        },
        [](int32_t rc, long) {
            EXPECT_EQ(rc, ACL_RC_NO_MEMORY);
            EXPECT_EQ(rytest::error_msgnum(), 89);
        });
    EXPECT_GE(sites, 2);  // the buffer, and ordering the unsorted trees
    acl__free_trees(&trees);

    size_t off = 5 + acl__load_le32(good.data() + 5);
    const unsigned char *second = good.data() + off;
    sites = rytest::for_each_alloc_failure(
        [&] {
            sec_acltree_t t = reinterpret_cast<sec_acltree_t>(1);
            int32_t rc = sec__subacl_to_acltree(second, good.size() - off, &t);
            if (rc) {
                EXPECT_EQ(t, nullptr);
            }
            sec__free_acltree(t);
            return rc;
        },
        [](int32_t rc, long) {
            EXPECT_EQ(rc, ACL_RC_NO_MEMORY);
            EXPECT_EQ(rytest::error_msgnum(), 89);
        });
    EXPECT_GE(sites, 3);
}

}  // namespace
