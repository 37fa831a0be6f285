// Listing compiled ACLs as entry records.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "lib_acl_bytes.h"
#include "ryacl.h"
#include "ryacl_test_support.h"

namespace {

using namespace libtest;
using strings = std::vector<std::string>;

const bytes kAcl = make_acl({subacl(4, "unix", {{3, "Alice"}, {1, "bob"}}), subacl(2, "", {{1, ""}}),
                             subacl(4, "krb", {{2, "k1"}}), subacl(16, "", {{4, "staff"}}),
                             subacl(4, "Unix", {{5, "shadowed"}})});

struct listed {
    int32_t rc;
    strings entries;
    bool empty;  // count 0 and no array, or never touched
};

listed list(const bytes &b, int type = -1, const char *mech = nullptr) {
    sec_buffer_desc d = own(b);
    sec_acle_list_desc l{-1, reinterpret_cast<sec_acle_t *>(0x1)};
    int32_t rc = type < 0 ? sec_list_acl(&d, &l)
                          : sec_list_acl_by_type(&d, static_cast<unsigned char>(type), mech, &l);
    // A list refused before filling began is left as given (and counts as
    // holding nothing of the ACL).
    listed r{rc, {}, true};
    if (rc == 0 || l.acles != reinterpret_cast<sec_acle_t *>(0x1)) {
        r.entries = describe(l);
        r.empty = l.count == 0 && l.acles == nullptr;
        sec_release_aclelist(&l);
    }
    drop(d);
    return r;
}

TEST(List, WholeAclInBufferOrder) {
    listed r = list(kAcl);
    ASSERT_EQ(r.rc, 0);
    EXPECT_EQ(r.entries, (strings{"4:unix:Alice:3", "4:unix:bob:1", "2::-:1", "4:krb:k1:2",
                                  "16::staff:4", "4:Unix:shadowed:5"}));
    for (const bytes &b : {bytes{}, bytes{0x85, 1, 2, 0, 0}}) {
        r = list(b);
        EXPECT_EQ(r.rc, 0);
        EXPECT_TRUE(r.empty);
    }
}

TEST(List, ByTypeAndMechanism) {
    EXPECT_EQ(list(kAcl, 4).entries,
              (strings{"4:unix:Alice:3", "4:unix:bob:1", "4:krb:k1:2", "4:Unix:shadowed:5"}));
    // With a mechanism, only the first sub-ACL that matches it.
    EXPECT_EQ(list(kAcl, 4, "UNIX").entries, (strings{"4:unix:Alice:3", "4:unix:bob:1"}));
    EXPECT_EQ(list(kAcl, 16, "ignored").entries, (strings{"16::staff:4"}));
    EXPECT_EQ(list(kAcl, 2).entries, (strings{"2::-:1"}));
    listed r = list(kAcl, 8);
    EXPECT_EQ(r.rc, 0);
    EXPECT_TRUE(r.empty);
    r = list(kAcl, 4, "nfs");
    EXPECT_EQ(r.rc, 0);
    EXPECT_TRUE(r.empty);

    EXPECT_EQ(list(kAcl, 4, "abcdefghijklmnopq").rc, ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 3"), std::string::npos);
    EXPECT_EQ(list(kAcl, 4, "").rc, ACL_RC_BAD_ARGS);
    EXPECT_EQ(list(kAcl, 3).rc, ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 2\n\tParameter value: 0x3"),
              std::string::npos);
}

TEST(List, ParametersAndDescriptors) {
    sec_acle_list_desc l{0, nullptr};
    sec_buffer_desc d = own(kAcl);
    EXPECT_EQ(sec_list_acl(nullptr, &l), ACL_RC_BAD_ARGS);
    EXPECT_EQ(sec_list_acl(&d, nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 2"), std::string::npos);
    EXPECT_EQ(sec_list_acl_by_type(&d, 4, nullptr, nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 4"), std::string::npos);
    drop(d);

    sec_buffer_desc lying{5, nullptr};
    EXPECT_EQ(sec_list_acl(&lying, &l), ACL_RC_BAD_ACL);
    EXPECT_EQ(rytest::error_msgnum(), 96);
    EXPECT_EQ(list({0x84, 1, 2, 0, 0}).rc, ACL_RC_BAD_ACL);
    EXPECT_EQ(list({0x85, 2, 2, 0, 0}, 4).rc, ACL_RC_BAD_ACL);
    // The byte order is not the listing's concern.
    bytes other = make_acl({subacl(2, "", {{0, ""}})});
    other[2] = 7;
    EXPECT_EQ(list(other).rc, 0);

    // Releasing: absent lists and empty lists are left alone.
    sec_release_aclelist(nullptr);
    sec_acle_list_desc zero{0, reinterpret_cast<sec_acle_t *>(0x1)};
    sec_release_aclelist(&zero);
    EXPECT_EQ(zero.acles, reinterpret_cast<sec_acle_t *>(0x1));
}

TEST(List, EachAllocationFailureEmptiesTheList) {
    for (int type : {-1, 4}) {
        sec_buffer_desc d = own(kAcl);
        sec_acle_list_desc l{0, nullptr};
        long sites = rytest::for_each_alloc_failure(
            [&] { return type < 0 ? sec_list_acl(&d, &l) : sec_list_acl_by_type(&d, 4, nullptr, &l); },
            [&](int32_t rc, long) {
                EXPECT_EQ(rc, ACL_RC_NO_MEMORY);
                EXPECT_EQ(rytest::error_msgnum(), 89);
                EXPECT_EQ(l.count, 0);
                EXPECT_EQ(l.acles, nullptr);
            });
        EXPECT_GT(sites, 3);
        EXPECT_EQ(l.count, type < 0 ? 6 : 4);
        sec_release_aclelist(&l);
        drop(d);
    }
}

TEST(List, ALargeSubaclListsInOrder) {
    std::vector<ent> many;
    for (int i = 0; i < 100000; ++i) {
        char id[16];
        std::snprintf(id, sizeof id, "u%06d", i);
        many.push_back({static_cast<uint32_t>(i), id});
    }
    sec_buffer_desc d = own(make_acl({subacl(4, "unix", many)}));
    sec_acle_list_desc l{0, nullptr};
    ASSERT_EQ(sec_list_acl(&d, &l), 0);
    ASSERT_EQ(l.count, 100000);
    EXPECT_STREQ(l.acles[0]->id, "u000000");
    EXPECT_STREQ(l.acles[99999]->id, "u099999");
    EXPECT_EQ(l.acles[512]->perm, 512u);
    sec_release_aclelist(&l);
    drop(d);
}

// Every mutant of a valid buffer through both listings: a list or a clean
// refusal with an empty list, never a read outside the block.
TEST(Mutation, ListingsOfEveryMutant) {
    const bytes base = make_acl({subacl(4, "unix", {{1, "ann"}, {2, "bo"}}), subacl(2, "", {{4, ""}}),
                                 subacl(16, "", {{16, "g"}})});
    for (const bytes &m : mutants(base, {3, 5, 9, 10, 14, 19, 20, 21}, 3)) {
        for (auto [type, mech] : {std::pair{-1, ""}, {4, "unix"}, {4, nullptr}, {16, nullptr}}) {
            listed r = list(m, type, mech);
            EXPECT_TRUE(r.rc == 0 || r.rc == ACL_RC_BAD_ACL || r.rc == ACL_RC_BAD_ACLE) << r.rc;
            if (r.rc) {
                EXPECT_TRUE(r.empty);
            }
        }
    }
}

}  // namespace
