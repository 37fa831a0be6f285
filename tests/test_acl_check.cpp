// Compiled ACLs from outside: validation, byte order, copying, creating,
// releasing, and every operation on hostile bytes.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "lib_acl_bytes.h"
#include "ryacl.h"
#include "ryacl_acl_edit.h"
#include "ryacl_test_support.h"

namespace {

using namespace libtest;

int32_t verify(const bytes &b) {
    sec_buffer_desc d = own(b);
    int32_t rc = sec_convert_acl_to_host(1, &d);
    drop(d);
    return rc;
}

bytes set(bytes b, size_t off, unsigned value) {
    b[off] = static_cast<unsigned char>(value);
    return b;
}

TEST(Validation, EachRuleWithItsCodeAndMessage) {
    const bytes user = make_acl({subacl(4, "unix", {{1, "ann"}})});
    const bytes group = make_acl({subacl(16, "", {{1, "staff"}})});
    const bytes groups2 = make_acl({subacl(16, "", {{1, "staff"}}), subacl(16, "", {{1, "staff"}})});
    bytes cut = group;  // the identifier loses its NUL at the very end
    cut.pop_back();
    bytes lying_id = set(make_acl({subacl(16, "", {{1, "staff"}, {2, "wheel"}})}), 33, 7);  // "wheel" is 6
    lying_id.push_back(0);
    struct fault { const char *what; bytes buf; int32_t rc, msg; } const faults[] = {
        {"empty ACL", {0x85, 1, 2, 0, 0}, 0, 0},
        {"worked example", worked_example(), 0, 0},
        {"no bytes", {}, 42, 96},
        {"buffer type", {0x84, 1, 2, 0, 0}, 42, 96},
        {"version", {0x85, 2, 2, 0, 0}, 42, 96},
        {"short header", {0x85, 1, 2, 0}, 42, 106},
        {"mech length 1", set(user, 14, 1), 42, 110},
        {"mech length 18", set(user, 14, 18), 42, 110},
        {"mech text shorter than its length", set(user, 14, 6), 42, 111},
        {"two anyother entries", make_acl({subacl(2, "", {{1, ""}, {2, ""}})}), 42, 109},
        {"identifier in an anyother entry", set(make_acl({subacl(2, "", {{1, ""}})}), 20, 1), 43, 113},
        {"entry version, only sub-ACL", set(group, 15, 2), 43, 112},
        {"entry version, first of two",
         set(make_acl({subacl(16, "", {{1, "staff"}}), subacl(4, "unix", {{1, "ann"}})}), 15, 2), 42, 97},
        {"identifier text and length disagree", lying_id, 43, 114},
        {"unknown type", set(group, 9, 3), 42, 107},
        {"mechanism in a group sub-ACL", set(group, 14, 2), 42, 108},
        {"sub-ACL longer than where the next starts", set(groups2, 5, groups2[5] + 1u), 42, 97},
        {"entry count past the end", set(group, 10, 200), 42, 97},
        {"sub-ACL count past the end", set(group, 3, 2), 42, 97},
        {"sub-ACL length past the end", set(group, 8, 0x7f), 42, 97},
        {"identifier cut by the end", cut, 42, 97},
    };
    for (const fault &f : faults) {
        EXPECT_EQ(verify(f.buf), f.rc) << f.what;
        EXPECT_EQ(rytest::error_msgnum(), f.msg) << f.what;
    }
    // Location-only messages put the file and line where the text wants them.
    verify(faults[10].buf);
    EXPECT_NE(rytest::error_text().find("(security/ACL/lib/ryacl_acl:"), std::string::npos);
    verify(faults[5].buf);
    EXPECT_NE(rytest::error_text().find("Its length (4)"), std::string::npos);
    EXPECT_EQ(sec_convert_acl_to_host(1, nullptr), ACL_RC_BAD_ARGS);
    sec_buffer_desc lying{5, nullptr};  // a length without a block is not read through
    EXPECT_EQ(with_msg(sec_convert_acl_to_host(0, &lying)), rc_msg(ACL_RC_BAD_ACL, 96));
}

TEST(ByteOrder, WorkedExampleReversedConvertsBack) {
    const bytes host = worked_example();
    ASSERT_EQ(host.size(), 61u);
    const bytes rev = reversed(host);
    EXPECT_EQ(rev[5 + 3], 0x27);  // the length field really was reversed
    sec_buffer_desc d = own(rev);
    ASSERT_EQ(sec_convert_acl_to_host(0, &d), 0);
    EXPECT_EQ(view(d), host);
    ASSERT_EQ(sec_convert_acl_to_host(1, &d), 0);
    EXPECT_EQ(view(d), host);
    drop(d);

    const bytes junk = {0x85, 1, 2, 9, 9, 0xff, 0xff};  // host order, not walked without verify
    d = own(junk);
    EXPECT_EQ(sec_convert_acl_to_host(0, &d), 0);
    EXPECT_EQ(view(d), junk);
    EXPECT_EQ(sec_convert_acl_to_host(1, &d), ACL_RC_BAD_ACL);
    drop(d);

    // A reversed buffer that breaks part-way keeps byte 2.
    bytes broken = reversed(make_acl({subacl(16, "", {{1, "a"}}), subacl(16, "", {{2, "b"}})}));
    broken[5] ^= 1;  // the first length, reversed: low bit of its top byte
    broken[8] ^= 1;
    d = own(broken);
    EXPECT_EQ(with_msg(sec_convert_acl_to_host(0, &d)), rc_msg(ACL_RC_BAD_ACL, 97));
    EXPECT_EQ(static_cast<unsigned char *>(d.value)[2], 1);
    drop(d);
}

TEST(CopyCreateRelease, ParametersAndBlocks) {
    sec_buffer_desc d{7, reinterpret_cast<void *>(0x1)}, lying{5, nullptr};
    const unsigned char data[] = {1, 2, 3};
    EXPECT_EQ(sec_read_acl_from_data(0, data, &d), ACL_RC_BAD_ARGS);
    EXPECT_EQ(sec_read_acl_from_data(3, nullptr, &d), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 2"), std::string::npos);
    EXPECT_EQ(d.length, 7);  // refused calls touch nothing
    ASSERT_EQ(sec_read_acl_from_data(3, data, &d), 0);  // no ACL, copied all the same
    EXPECT_EQ(view(d), (bytes{1, 2, 3}));
    // Only an ACL block is freed, and a length alone is not read through.
    EXPECT_EQ(with_msg(sec_release_acl(&d)), rc_msg(ACL_RC_BAD_ACL, 93));
    EXPECT_EQ(view(d), (bytes{1, 2, 3}));
    drop(d);
    EXPECT_EQ(sec_release_acl(&lying), ACL_RC_BAD_ACL);
    EXPECT_EQ(lying.length, 5);
    EXPECT_EQ(sec_release_acl(nullptr), 0);

    EXPECT_EQ(sec_create_empty_acl(nullptr), ACL_RC_BAD_ARGS);
    ASSERT_EQ(sec_create_empty_acl(&d), 0);
    EXPECT_EQ(view(d), (bytes{0x85, 1, 2, 0, 0}));
    EXPECT_EQ(sec_release_acl(&d), 0);  // and clears the error the create left
    EXPECT_EQ(rytest::error_code(), 0);
    EXPECT_TRUE(d.length == 0 && d.value == nullptr);
}

int32_t same(const char *client, const char *entry) { return std::strcmp(client, entry); }

// Every bit flipped, every value at the header and the fields of the first
// sub-ACL and entry, every truncation, in host and reversed order, through
// every operation that takes a compiled ACL, without validation first: a
// result or a clean refusal that leaves every byte and an empty list.  An
// accepted mutant validates again unchanged.  Reads and writes outside the
// exact-size block are the sanitizer's to catch.
TEST(Mutation, EveryOperationOnEveryMutant) {
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "unix", same), 0);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "unix", same), 0);
    const bytes host = make_acl({subacl(4, "unix", {{3, "Alice"}, {1, "bob"}}), subacl(2, "", {{1, ""}}),
                                 subacl(8, "unix", {{8, "e1"}}), subacl(16, "", {{4, "g"}, {8, "h"}})});
    auto clean = [](int32_t rc) {
        return rc == 0 || rc == ACL_RC_BAD_ACL || rc == ACL_RC_BAD_ACLE || rc == ACL_RC_NO_MATCH;
    };
    sec_acle_desc edits[] = {entry(4, 9, "unix", "bz"), entry(16, 9, "", "a"), entry(4, 0, "unix", "bob"),
                             entry(16, 0, "", "h")};  // added, added, deleted, deleted
    size_t accepted = 0;
    for (const bytes &base : {host, reversed(host)}) {
        for (const bytes &m : mutants(base, {2, 3, 4, 5, 8, 9, 10, 13, 14, 15, 20, 25, 26})) {
            sec_buffer_desc d = own(m);
            int32_t rc = sec_convert_acl_to_host(1, &d);
            EXPECT_TRUE(clean(rc)) << rc;
            if (rc == 0) {
                ++accepted;
                const bytes once = view(d);
                EXPECT_TRUE(sec_convert_acl_to_host(1, &d) == 0 || m[2] != 2);  // reversal alone does not validate
                EXPECT_EQ(view(d), once);
            }
            drop(d);

            d = own(m);  // evaluations and listings only read
            uint32_t perm = 0;
            for (unsigned type : {1u, 2u, 4u, 0x84u, 8u}) {
                rc = sec__single_acle_perm(&d, static_cast<unsigned char>(type), "unix", nullptr, "bob", &perm);
                EXPECT_TRUE(clean(rc) && (rc == 0 || rytest::error_code() == rc)) << rc;
            }
            sec_buffer_desc groups[2] = {{0, const_cast<char *>("g")}, {0, const_cast<char *>("x")}};
            EXPECT_TRUE(clean(sec__group_acles_perm(&d, 2, groups, &perm)));
            for (unsigned type : {0u, 4u, 16u}) {
                sec_acle_list_desc l{0, nullptr};
                rc = type ? sec_list_acl_by_type(&d, static_cast<unsigned char>(type), type == 4 ? "unix" : nullptr, &l)
                          : sec_list_acl(&d, &l);
                EXPECT_TRUE(clean(rc) && (rc == 0 || (l.count == 0 && l.acles == nullptr))) << rc;
                sec_release_aclelist(&l);
            }
            EXPECT_EQ(view(d), m);
            drop(d);

            for (bool direct : {true, false}) {
                acl__edit_direct_enabled = direct;
                for (size_t k = 0; k < std::size(edits) && !m.empty(); ++k) {
                    d = own(m);
                    rc = k < 2 ? sec_add_acle_to_acl(&edits[k], &d) : sec_del_acle_from_acl(&edits[k], &d);
                    EXPECT_TRUE(clean(rc) && (rc == 0 || view(d) == m)) << rc;
                    drop(d);
                }
            }
        }
    }
    acl__edit_direct_enabled = true;
    EXPECT_GT(accepted, 0u);
}

}  // namespace
