// Editing compiled ACLs: adding and deleting entries in place.
#include <gtest/gtest.h>

#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "lib_acl_bytes.h"
#include "ryacl.h"
#include "ryacl_acl_edit.h"
#include "ryacl_test_support.h"

namespace {

using namespace libtest;

int32_t add(sec_buffer_desc &d, unsigned type, uint32_t perm, const std::string &mech,
            const std::string &id, bool noupdate = false) {
    entry_rec e(type, perm, mech, id, type >= 4);
    return noupdate ? sec_add_acle_to_acl2(e.get(), &d) : sec_add_acle_to_acl(e.get(), &d);
}
int32_t del(sec_buffer_desc &d, unsigned type, const std::string &mech, const std::string &id,
            uint32_t perm = 0) {
    entry_rec e(type, perm, mech, id, type >= 4);
    return sec_del_acle_from_acl(e.get(), &d);
}

TEST(Add, IntoAnEmptyDescriptorAndJoiningAMechanismOfOtherCase) {
    sec_buffer_desc d{0, nullptr};
    ASSERT_EQ(add(d, 4, 3, "unix", "Alice"), 0);
    EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{3, "Alice"}})}));
    ASSERT_EQ(add(d, 4, 1, "UNIX", "bob"), 0);
    EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{3, "Alice"}, {1, "bob"}})}));
    ASSERT_EQ(add(d, 2, 1, "", ""), 0);
    EXPECT_EQ(view(d), worked_example());
    drop(d);

    for (unsigned type : {1u, 2u, 8u, 16u}) {
        sec_buffer_desc e{0, nullptr};
        ASSERT_EQ(add(e, type, 5, type == 8 ? "krb" : "", type >= 8 ? "x" : ""), 0) << type;
        EXPECT_EQ(view(e), make_acl({subacl(type, type == 8 ? "krb" : "", {{5, type >= 8 ? "x" : ""}})}));
        drop(e);
    }
}

TEST(Add, ReplaceKeepsLengthAndAdd2LeavesEveryByte) {
    sec_buffer_desc d = own(worked_example());
    ASSERT_EQ(add(d, 4, 0, "Unix", "ALICE"), 0);  // mask 0 clears
    EXPECT_EQ(d.length, 61);
    EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{0, "Alice"}, {1, "bob"}}),
                                 subacl(2, "", {{1, ""}})}));
    ASSERT_EQ(add(d, 2, 0x30, "", ""), 0);
    EXPECT_EQ(static_cast<unsigned char *>(d.value)[54 + 1], 0x30);

    const bytes before = view(d);
    EXPECT_EQ(add(d, 4, 7, "unix", "BOB", true), ACL_RC_BAD_ACLE);
    EXPECT_EQ(rytest::error_msgnum(), 144);
    EXPECT_EQ(add(d, 2, 7, "", "", true), ACL_RC_BAD_ACLE);
    EXPECT_EQ(rytest::error_msgnum(), 160);
    EXPECT_EQ(view(d), before);
    drop(d);
}

TEST(Add, NewSubaclIsAppendedAndAGrownOneKeepsItsPlace) {
    sec_buffer_desc d = own(worked_example());
    ASSERT_EQ(add(d, 16, 2, "", "staff"), 0);
    EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{3, "Alice"}, {1, "bob"}}),
                                 subacl(2, "", {{1, ""}}), subacl(16, "", {{2, "staff"}})}));
    ASSERT_EQ(add(d, 4, 9, "unix", "al"), 0);
    EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{9, "al"}, {3, "Alice"}, {1, "bob"}}),
                                 subacl(2, "", {{1, ""}}), subacl(16, "", {{2, "staff"}})}));
    ASSERT_EQ(add(d, 8, 1, "krb", "z"), 0);
    ASSERT_EQ(add(d, 8, 2, "krb", "a"), 0);  // expanded entries keep insertion order
    EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{9, "al"}, {3, "Alice"}, {1, "bob"}}),
                                 subacl(2, "", {{1, ""}}), subacl(16, "", {{2, "staff"}}),
                                 subacl(8, "krb", {{1, "z"}, {2, "a"}})}));
    drop(d);
}

TEST(Delete, EntriesSubaclsAndTheLastEntryOfAll) {
    sec_buffer_desc d = own(worked_example());
    ASSERT_EQ(del(d, 4, "UNIX", "alice", 0xffff), 0);  // the permission is ignored
    EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{1, "bob"}}), subacl(2, "", {{1, ""}})}));
    ASSERT_EQ(del(d, 4, "unix", "bob"), 0);
    EXPECT_EQ(view(d), make_acl({subacl(2, "", {{1, ""}})}));
    ASSERT_EQ(del(d, 2, "", ""), 0);
    EXPECT_EQ(view(d), (bytes{0x85, 1, 2, 0, 0}));

    EXPECT_EQ(del(d, 2, "", ""), ACL_RC_NO_MATCH);
    EXPECT_EQ(rytest::error_msgnum(), 105);
    drop(d);
    EXPECT_EQ(del(d, 2, "", ""), ACL_RC_BAD_ACL);
    EXPECT_EQ(rytest::error_msgnum(), 93);

    d = own(worked_example());
    EXPECT_EQ(del(d, 4, "unix", "carol"), ACL_RC_NO_MATCH);
    EXPECT_EQ(rytest::error_msgnum(), 105);
    EXPECT_EQ(del(d, 4, "nfs", "bob"), ACL_RC_NO_MATCH);
    EXPECT_NE(rytest::error_text().find("mechanism (nfs), and the identifier (bob)"), std::string::npos);
    EXPECT_EQ(view(d), worked_example());
    drop(d);

    // A sub-ACL of no entries (made outside) has nothing to delete.
    d = own(make_acl({subacl(16, "", {})}));
    EXPECT_EQ(del(d, 16, "", "staff"), ACL_RC_BAD_ACLE);
    EXPECT_EQ(rytest::error_msgnum(), 105);
    drop(d);
}

TEST(Edit, ParametersAndHeadersAreRefusedBeforeAnyChange) {
    sec_buffer_desc d = own(worked_example());
    entry_rec ok(4, 1, "unix", "x");
    EXPECT_EQ(sec_add_acle_to_acl(nullptr, &d), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("sec_add_acle_to_acl"), std::string::npos);
    EXPECT_EQ(sec_add_acle_to_acl2(ok.get(), nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 2"), std::string::npos);
    EXPECT_EQ(sec_del_acle_from_acl(nullptr, &d), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("sec_del_acle_from_acl"), std::string::npos);

    entry_rec bad(3, 1, "unix", "x");
    EXPECT_EQ(sec_add_acle_to_acl(bad.get(), &d), ACL_RC_BAD_ACLE);
    EXPECT_EQ(rytest::error_msgnum(), 103);
    entry_rec nomech(4, 1, "", "x");
    EXPECT_EQ(sec_add_acle_to_acl(nomech.get(), &d), ACL_RC_BAD_ACLE);
    EXPECT_EQ(rytest::error_msgnum(), 104);
    entry_rec noid(16, 1, "", "", false);
    EXPECT_EQ(sec_del_acle_from_acl(noid.get(), &d), ACL_RC_BAD_ACLE);
    EXPECT_EQ(rytest::error_msgnum(), 104);
    entry_rec unterminated(4, 1, "", "x");
    std::memset(unterminated.d.mech, 'm', sizeof unterminated.d.mech);
    EXPECT_EQ(sec_add_acle_to_acl(unterminated.get(), &d), ACL_RC_BAD_ACLE);
    EXPECT_EQ(rytest::error_msgnum(), 104);

    // Fields an anyother entry does not have are never looked at.
    entry_rec junk(2, 0x40, "", "");
    std::memset(junk.d.mech, 'm', sizeof junk.d.mech);
    junk.d.id = reinterpret_cast<char *>(0x8);
    EXPECT_EQ(sec_add_acle_to_acl(junk.get(), &d), 0);
    EXPECT_EQ(sec_del_acle_from_acl(junk.get(), &d), 0);
    EXPECT_EQ(add(d, 2, 1, "", ""), 0);
    EXPECT_EQ(view(d), worked_example());

    for (auto [off, val, msg] : {std::tuple{0, 0x84, 100}, {1, 2, 101}, {2, 1, 102}}) {
        bytes b = worked_example();
        b[static_cast<size_t>(off)] = static_cast<unsigned char>(val);
        sec_buffer_desc x = own(b);
        EXPECT_EQ(sec_add_acle_to_acl(ok.get(), &x), ACL_RC_BAD_ACL);
        EXPECT_EQ(rytest::error_msgnum(), msg);
        EXPECT_EQ(sec_del_acle_from_acl(ok.get(), &x), ACL_RC_BAD_ACL);
        EXPECT_EQ(rytest::error_msgnum(), msg);
        EXPECT_EQ(view(x), b);
        drop(x);
    }
    sec_buffer_desc half{5, nullptr};
    EXPECT_EQ(sec_add_acle_to_acl(ok.get(), &half), ACL_RC_BAD_ACL);
    EXPECT_EQ(half.length, 5);
    drop(d);
}

// The header counts sub-ACLs in 16 bits.
TEST(Add, A65536thSubaclIsRefused) {
    std::vector<bytes> subs(65535, subacl(2, "", {{1, ""}}));
    sec_buffer_desc d = own(make_acl(subs));
    const bytes before = view(d);
    EXPECT_EQ(add(d, 16, 1, "", "g"), ACL_RC_BAD_ACL);
    EXPECT_EQ(rytest::error_msgnum(), 93);
    EXPECT_EQ(view(d), before);
    EXPECT_EQ(add(d, 2, 3, "", ""), 0);  // an existing one still takes edits
    drop(d);
}

// Every allocation of each edit fails in turn: the code is 6 with message
// 89, an add leaves every byte (or, having made the buffer, nothing), and a
// delete leaves either the old ACL or, when only the shrinking failed, the
// edited one in the larger block.
TEST(Edit, EachAllocationFailure) {
    const bytes base = make_acl({subacl(4, "unix", {{3, "Alice"}, {1, "bob"}}), subacl(2, "", {{1, ""}}),
                                 subacl(8, "krb", {{1, "e1"}, {2, "e2"}})});
    struct op {
        const char *what;
        bool add;
        unsigned type;
        const char *mech, *id;
    };
    const op ops[] = {{"grow user", true, 4, "unix", "carl"},  {"new group", true, 16, "", "g"},
                      {"replace", true, 4, "unix", "bob"},     {"grow expanded", true, 8, "krb", "e3"},
                      {"delete user", false, 4, "unix", "bob"}, {"delete anyother", false, 2, "", ""},
                      {"delete expanded", false, 8, "krb", "e1"}};
    for (bool direct : {true, false}) {
        acl__edit_direct_enabled = direct;
        for (const op &o : ops) {
            sec_buffer_desc want = own(base);
            ASSERT_EQ(o.add ? add(want, o.type, 5, o.mech, o.id) : del(want, o.type, o.mech, o.id), 0);
            sec_buffer_desc d{0, nullptr};
            rytest::for_each_alloc_failure(
                [&] { return o.add ? add(d, o.type, 5, o.mech, o.id) : del(d, o.type, o.mech, o.id); },
                [&](int32_t rc, long nth) {
                    EXPECT_EQ(rc, ACL_RC_NO_MEMORY) << o.what << " " << nth;
                    EXPECT_EQ(rytest::error_msgnum(), 89);
                    bytes now = view(d);
                    EXPECT_TRUE(now == base || (!o.add && now == view(want))) << o.what << " " << nth;
                },
                [&] {
                    drop(d);
                    d = own(base);
                });
            EXPECT_EQ(view(d), view(want)) << o.what;
            drop(d);
            drop(want);
        }
        // The buffer an add made for itself goes again when the add fails.
        sec_buffer_desc e{0, nullptr};
        rytest::for_each_alloc_failure([&] { return add(e, 4, 1, "unix", "x"); },
                                       [&](int32_t rc, long) {
                                           EXPECT_EQ(rc, ACL_RC_NO_MEMORY);
                                           EXPECT_EQ(e.length, 0);
                                           EXPECT_EQ(e.value, nullptr);
                                       });
        drop(e);
    }
    acl__edit_direct_enabled = true;
}

// The direct byte-level edit of sorted sub-ACLs against the tree road: the
// same random edits on both give the same bytes and codes at every step.
TEST(Edit, DirectAndTreeRoadsAgree) {
    std::mt19937 rng(12345);
    // Short names, and long ones sharing prefixes of a word and more, in
    // either case, around the word boundary.
    const char *names[] = {"a",         "B",          "b",           "cc",          "Cc",
                           "eee",       "G",          "",            "service_a",   "service_",
                           "SERVICE_b", "service_ab", "servicexa",   "service_long_name_1",
                           "Service_Long_Name_1",     "service_long_name_2", "service_long_name_",
                           "servicE_lonG_namE_10"};
    sec_buffer_desc fast{0, nullptr}, slow{0, nullptr};
    for (int step = 0; step < 6000; ++step) {
        unsigned type = (rng() % 3 == 0) ? 16 : 4;
        const char *mech = rng() % 2 ? "unix" : "UNIX";
        std::string id = names[rng() % (sizeof names / sizeof *names)];
        uint32_t perm = rng() % 16;
        int kind = static_cast<int>(rng() % 3);
        int32_t rc[2];
        for (int road = 0; road < 2; ++road) {
            acl__edit_direct_enabled = road == 0;
            sec_buffer_desc &d = road == 0 ? fast : slow;
            rc[road] = kind == 2 ? del(d, type, mech, id) : add(d, type, perm, mech, id, kind == 1);
            if (rc[road]) rc[road] = rc[road] * 1000 + rytest::error_msgnum();
        }
        ASSERT_EQ(rc[0], rc[1]) << "step " << step;
        ASSERT_EQ(view(fast), view(slow)) << "step " << step;
    }
    // A sub-ACL from outside that is not in order goes down the tree road
    // and comes back sorted either way.
    bytes disorder = make_acl({subacl(4, "unix", {{1, "b"}, {2, "a"}, {3, "B"}})});
    for (int road = 0; road < 2; ++road) {
        acl__edit_direct_enabled = road == 0;
        sec_buffer_desc d = own(disorder);
        ASSERT_EQ(add(d, 4, 4, "unix", "c"), 0);
        EXPECT_EQ(view(d), make_acl({subacl(4, "unix", {{2, "a"}, {3, "b"}, {4, "c"}})}));
        drop(d);
    }
    acl__edit_direct_enabled = true;
    drop(fast);
    drop(slow);
}

// Every mutant of a valid buffer through an add and a delete on each road:
// a result or a clean refusal, never a read or write outside the block.
TEST(Mutation, EditsOfEveryMutant) {
    const bytes base = make_acl({subacl(4, "unix", {{1, "ann"}, {2, "bo"}}), subacl(2, "", {{4, ""}}),
                                 subacl(16, "", {{16, "g"}, {8, "h"}})});
    const std::vector<bytes> all = mutants(base, {3, 5, 9, 14, 15, 20, 21}, 3);
    for (bool direct : {true, false}) {
        acl__edit_direct_enabled = direct;
        for (const bytes &m : all) {
            if (m.empty()) continue;  // an empty descriptor is a valid place to add
            for (int kind = 0; kind < 4; ++kind) {
                sec_buffer_desc d = own(m);
                int32_t rc = kind == 0   ? add(d, 4, 9, "unix", "bz")
                             : kind == 1 ? add(d, 16, 9, "", "a")
                             : kind == 2 ? del(d, 4, "unix", "bo")
                                         : del(d, 16, "", "h");
                EXPECT_TRUE(rc == 0 || rc == ACL_RC_BAD_ACL || rc == ACL_RC_BAD_ACLE ||
                            rc == ACL_RC_NO_MATCH)
                    << rc;
                if (rc) {
                    EXPECT_EQ(view(d), m);
                }
                drop(d);
            }
        }
    }
    acl__edit_direct_enabled = true;
}

}  // namespace
