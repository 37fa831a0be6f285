// Editing compiled ACLs: adding and deleting entries in place.
#include <gtest/gtest.h>

#include <cstring>
#include <random>
#include <string>
#include <tuple>
#include <vector>

#include "lib_acl_bytes.h"
#include "ryacl.h"
#include "ryacl_acl_edit.h"
#include "ryacl_test_support.h"

namespace {

using namespace libtest;

int32_t add(sec_buffer_desc &d, unsigned type, uint32_t perm, const std::string &mech, const std::string &id,
            bool noupdate = false) {
    sec_acle_desc e = entry(type, perm, mech.c_str(), id.c_str());
    return noupdate ? sec_add_acle_to_acl2(&e, &d) : sec_add_acle_to_acl(&e, &d);
}
int32_t del(sec_buffer_desc &d, unsigned type, const std::string &mech, const std::string &id, uint32_t perm = 0) {
    sec_acle_desc e = entry(type, perm, mech.c_str(), id.c_str());
    return sec_del_acle_from_acl(&e, &d);
}

TEST(Add, BuildsTheWorkedExampleAndJoinsAMechanismOfOtherCase) {
    sec_buffer_desc d{0, nullptr};
    ASSERT_EQ(add(d, 4, 3, "unix", "Alice"), 0);
    ASSERT_EQ(add(d, 4, 1, "UNIX", "bob"), 0);
    ASSERT_EQ(add(d, 2, 1, "", ""), 0);
    EXPECT_EQ(view(d), worked_example());
    drop(d);
    for (unsigned type : {1u, 8u, 16u}) {
        ASSERT_EQ(add(d, type, 5, type == 8 ? "krb" : "", "x"), 0) << type;
        EXPECT_EQ(view(d), make_acl({subacl(type, type == 8 ? "krb" : "", {{5, type >= 8 ? "x" : ""}})}));
        drop(d);
    }
}

TEST(Add, ReplaceKeepsLengthAndAdd2LeavesEveryByte) {
    sec_buffer_desc d = own(worked_example());
    ASSERT_EQ(add(d, 4, 0, "Unix", "ALICE"), 0);  // mask 0 clears
    EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{0, "Alice"}, {1, "bob"}}), subacl(2, "", {{1, ""}})}));
    ASSERT_EQ(add(d, 2, 0x30, "", ""), 0);
    EXPECT_EQ(static_cast<unsigned char *>(d.value)[55], 0x30);
    const bytes before = view(d);
    EXPECT_EQ(with_msg(add(d, 4, 7, "unix", "BOB", true)), rc_msg(ACL_RC_BAD_ACLE, 144));
    EXPECT_EQ(with_msg(add(d, 2, 7, "", "", true)), rc_msg(ACL_RC_BAD_ACLE, 160));
    EXPECT_EQ(view(d), before);
    drop(d);
}

TEST(Add, NewSubaclIsAppendedAndAGrownOneKeepsItsPlace) {
    sec_buffer_desc d = own(worked_example());
    ASSERT_EQ(add(d, 16, 2, "", "staff"), 0);
    ASSERT_EQ(add(d, 4, 9, "unix", "al"), 0);
    ASSERT_EQ(add(d, 8, 1, "krb", "z"), 0);
    ASSERT_EQ(add(d, 8, 2, "krb", "a"), 0);  // expanded entries keep insertion order
    EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{9, "al"}, {3, "Alice"}, {1, "bob"}}), subacl(2, "", {{1, ""}}),
                                 subacl(16, "", {{2, "staff"}}), subacl(8, "krb", {{1, "z"}, {2, "a"}})}));
    drop(d);

    // The header counts sub-ACLs in 16 bits: no 65536th, but the others
    // still take edits.
    d = own(make_acl(std::vector<bytes>(65535, subacl(2, "", {{1, ""}}))));
    const bytes full = view(d);
    EXPECT_EQ(with_msg(add(d, 16, 1, "", "g")), rc_msg(ACL_RC_BAD_ACL, 93));
    EXPECT_EQ(view(d), full);
    EXPECT_EQ(add(d, 2, 3, "", ""), 0);
    drop(d);
}

TEST(Delete, EntriesSubaclsAndTheLastEntryOfAll) {
    sec_buffer_desc d = own(worked_example());
    ASSERT_EQ(del(d, 4, "UNIX", "alice", 0xffff), 0);  // the permission is ignored
    EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{1, "bob"}}), subacl(2, "", {{1, ""}})}));
    ASSERT_EQ(del(d, 4, "unix", "bob"), 0);
    ASSERT_EQ(del(d, 2, "", ""), 0);
    EXPECT_EQ(view(d), (bytes{0x85, 1, 2, 0, 0}));
    EXPECT_EQ(with_msg(del(d, 2, "", "")), rc_msg(ACL_RC_NO_MATCH, 105));
    drop(d);
    EXPECT_EQ(with_msg(del(d, 2, "", "")), rc_msg(ACL_RC_BAD_ACL, 93));

    d = own(worked_example());
    EXPECT_EQ(with_msg(del(d, 4, "unix", "carol")), rc_msg(ACL_RC_NO_MATCH, 105));
    EXPECT_EQ(del(d, 4, "nfs", "bob"), ACL_RC_NO_MATCH);
    EXPECT_NE(rytest::error_text().find("mechanism (nfs), and the identifier (bob)"), std::string::npos);
    EXPECT_EQ(view(d), worked_example());
    drop(d);
    d = own(make_acl({subacl(16, "", {})}));  // made outside: nothing to delete
    EXPECT_EQ(with_msg(del(d, 16, "", "staff")), rc_msg(ACL_RC_BAD_ACLE, 105));
    drop(d);
}

TEST(Edit, ParametersEntriesAndHeadersAreRefusedBeforeAnyChange) {
    sec_buffer_desc d = own(worked_example());
    sec_acle_desc ok = entry(4, 1, "unix", "x");
    EXPECT_EQ(sec_add_acle_to_acl2(&ok, nullptr), ACL_RC_BAD_ARGS);
    // Both adds share one body, whose name the message gives.
    EXPECT_NE(rytest::error_text().find("sec_add_acle_to_acl\n\tPositional parameter number: 2"), std::string::npos);
    EXPECT_EQ(sec_del_acle_from_acl(nullptr, &d), ACL_RC_BAD_ARGS);

    sec_acle_desc unterminated = entry(4, 1, "", "x");
    std::memset(unterminated.mech, 'm', sizeof unterminated.mech);
    for (auto [e, msg] : {std::pair{entry(3, 1, "unix", "x"), 103}, {entry(4, 1, "", "x"), 104},
                          {entry(16, 1, "", nullptr), 104}, {unterminated, 104}}) {
        EXPECT_EQ(with_msg(sec_add_acle_to_acl(&e, &d)), rc_msg(ACL_RC_BAD_ACLE, msg));
        EXPECT_EQ(with_msg(sec_del_acle_from_acl(&e, &d)), rc_msg(ACL_RC_BAD_ACLE, msg));
    }
    // Fields an anyother entry does not have are never looked at.
    sec_acle_desc junk = entry(2, 0x40, "", "");
    std::memset(junk.mech, 'm', sizeof junk.mech);
    junk.id = reinterpret_cast<char *>(0x8);
    EXPECT_EQ(sec_add_acle_to_acl(&junk, &d), 0);
    EXPECT_EQ(sec_del_acle_from_acl(&junk, &d), 0);
    EXPECT_EQ(add(d, 2, 1, "", ""), 0);
    EXPECT_EQ(view(d), worked_example());
    drop(d);

    for (auto [off, val, msg] : {std::tuple{0, 0x84, 100}, {1, 2, 101}, {2, 1, 102}}) {
        bytes b = worked_example();
        b[static_cast<size_t>(off)] = static_cast<unsigned char>(val);
        sec_buffer_desc x = own(b);
        EXPECT_EQ(with_msg(sec_add_acle_to_acl(&ok, &x)), rc_msg(ACL_RC_BAD_ACL, msg));
        EXPECT_EQ(with_msg(sec_del_acle_from_acl(&ok, &x)), rc_msg(ACL_RC_BAD_ACL, msg));
        EXPECT_EQ(view(x), b);
        drop(x);
    }
    sec_buffer_desc half{5, nullptr};
    EXPECT_EQ(sec_add_acle_to_acl(&ok, &half), ACL_RC_BAD_ACL);
    EXPECT_EQ(half.length, 5);
}

// The direct byte-level edit of sorted sub-ACLs against the tree road: the
// same random edits on both give the same bytes and codes at every step.
TEST(Edit, DirectAndTreeRoadsAgree) {
    std::mt19937 rng(12345);
    // Short names, and long ones sharing prefixes of a word and more, in
    // either case, around the word boundary.
    const char *names[] = {"a", "B", "b", "cc", "Cc", "eee", "G", "", "service_a", "service_", "SERVICE_b",
                           "service_ab", "servicexa", "service_long_name_1", "Service_Long_Name_1",
                           "service_long_name_2", "service_long_name_", "servicE_lonG_namE_10"};
    sec_buffer_desc fast{0, nullptr}, slow{0, nullptr};
    for (int step = 0; step < 6000; ++step) {
        const unsigned type = rng() % 3 == 0 ? 16 : 4;
        const char *mech = rng() % 2 ? "unix" : "UNIX";
        const std::string id = names[rng() % std::size(names)];
        const uint32_t perm = rng() % 16;
        const int kind = static_cast<int>(rng() % 3);
        rc_msg rc[2];
        for (int road = 0; road < 2; ++road) {
            acl__edit_direct_enabled = road == 0;
            sec_buffer_desc &d = road == 0 ? fast : slow;
            rc[road] = with_msg(kind == 2 ? del(d, type, mech, id) : add(d, type, perm, mech, id, kind == 1));
        }
        ASSERT_EQ(rc[0], rc[1]) << "step " << step;
        ASSERT_EQ(view(fast), view(slow)) << "step " << step;
    }
    // A sub-ACL from outside that is out of order goes down the tree road
    // and comes back sorted either way.
    for (bool direct : {true, false}) {
        acl__edit_direct_enabled = direct;
        sec_buffer_desc d = own(make_acl({subacl(4, "unix", {{1, "b"}, {2, "a"}, {3, "B"}})}));
        ASSERT_EQ(add(d, 4, 4, "unix", "c"), 0);
        EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{2, "a"}, {3, "b"}, {4, "c"}})}));
        drop(d);
    }
    acl__edit_direct_enabled = true;
    drop(fast);
    drop(slow);
}

}  // namespace
