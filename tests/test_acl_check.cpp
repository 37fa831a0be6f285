// Compiled ACLs from outside: validation, byte order, copying, creating,
// releasing.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "lib_acl_bytes.h"
#include "ryacl.h"
#include "ryacl_test_support.h"

namespace {

using namespace libtest;

struct outcome {
    int32_t rc;
    int32_t msg;
};

outcome verify(const bytes &b) {
    sec_buffer_desc d = own(b);
    int32_t rc = sec_convert_acl_to_host(1, &d);
    outcome o{rc, rytest::error_msgnum()};
    drop(d);
    return o;
}

// Reverse every multi-byte field of a host-order buffer that is valid.
bytes reversed(bytes b) {
    auto sw16 = [&](size_t o) { std::swap(b[o], b[o + 1]); };
    auto sw32 = [&](size_t o) {
        std::swap(b[o], b[o + 3]);
        std::swap(b[o + 1], b[o + 2]);
    };
    unsigned nsub = b[3] | (b[4] << 8);
    size_t pos = 5;
    for (unsigned s = 0; s < nsub; ++s) {
        uint32_t len = b[pos] | (b[pos + 1] << 8) | (b[pos + 2] << 16) | (uint32_t(b[pos + 3]) << 24);
        uint32_t count = b[pos + 5] | (b[pos + 6] << 8) | (b[pos + 7] << 16) | (uint32_t(b[pos + 8]) << 24);
        size_t e = pos + 10 + b[pos + 9];
        for (uint32_t i = 0; i < count; ++i) {
            size_t idlen = b[e + 5] | (b[e + 6] << 8);
            sw32(e + 1);
            sw16(e + 5);
            e += 7 + idlen;
        }
        sw32(pos);
        sw32(pos + 5);
        pos += len;
    }
    sw16(3);
    b[2] = 1;
    return b;
}

TEST(Validation, EmptyAclPassesAndAShortHeaderIsRefused) {
    EXPECT_EQ(verify({0x85, 1, 2, 0, 0}).rc, 0);
    outcome o = verify({0x85, 1, 2, 0});
    EXPECT_EQ(o.rc, ACL_RC_BAD_ACL);
    EXPECT_EQ(o.msg, 106);
    EXPECT_NE(rytest::error_text().find("Its length (4)"), std::string::npos);
    EXPECT_EQ(verify(worked_example()).rc, 0);
}

TEST(Validation, EachRuleWithItsMessage) {
    auto user = [](const std::string &mech) { return subacl(4, mech, {{1, "ann"}}); };
    const bytes group_ok = subacl(16, "", {{1, "staff"}});
    struct fault {
        const char *what;
        bytes buf;
        int32_t rc, msg;
    };
    std::vector<fault> faults;

    bytes b = make_acl({user("unix")});
    b[5 + 9] = 1;  // mechanism length 1
    faults.push_back({"mech length 1", b, 42, 110});
    b = make_acl({user("unix")});
    b[5 + 9] = 18;
    faults.push_back({"mech length 18", b, 42, 110});
    b = make_acl({user("unix")});
    b[5 + 9] = 6;  // says 6 for a 4-character mechanism
    faults.push_back({"mech text shorter than its length", b, 42, 111});
    faults.push_back({"two anyother entries", make_acl({subacl(2, "", {{1, ""}, {2, ""}})}), 42, 109});
    b = make_acl({subacl(2, "", {{1, ""}})});
    b[5 + 10 + 5] = 1;  // identifier length 1 in an anyother entry
    faults.push_back({"identifier in an anyother entry", b, 43, 113});
    b = make_acl({group_ok});
    b[5 + 10] = 2;  // entry version
    faults.push_back({"entry version, only sub-ACL", b, 43, 112});
    b = make_acl({group_ok, user("unix")});
    b[5 + 10] = 2;
    faults.push_back({"entry version, first of two", b, 42, 97});
    b = make_acl({subacl(16, "", {{1, "staff"}, {2, "wheel"}})});
    b[5 + 10 + 7 + 6 + 5] = 7;  // "wheel" is 6 with its NUL
    b.push_back(0);
    faults.push_back({"identifier text and length disagree", b, 43, 114});
    b = make_acl({group_ok});
    b[5 + 4] = 3;
    faults.push_back({"unknown type", b, 42, 107});
    b = make_acl({subacl(16, "", {{1, "staff"}})});
    b[5 + 9] = 2;
    faults.push_back({"mechanism in a group sub-ACL", b, 42, 108});
    b = make_acl({group_ok, group_ok});
    b[5] += 1;  // the first sub-ACL claims one byte too many
    faults.push_back({"sub-ACL does not start where the last ended", b, 42, 97});
    b = make_acl({group_ok});
    b[5 + 5] = 200;  // the count lies: entries run past the end
    faults.push_back({"count past the end", b, 42, 97});
    b = make_acl({group_ok});
    b[3] = 2;  // a second sub-ACL that is not there
    faults.push_back({"sub-ACL count past the end", b, 42, 97});
    b = make_acl({group_ok});
    b[5 + 3] = 0x7f;  // sub-ACL length beyond the block
    faults.push_back({"sub-ACL length past the end", b, 42, 97});
    b = make_acl({subacl(16, "", {{1, "staff"}})});
    b.resize(b.size() - 1);  // identifier without its NUL at the very end
    faults.push_back({"identifier cut by the end", b, 42, 97});

    for (const fault &f : faults) {
        outcome o = verify(f.buf);
        EXPECT_EQ(o.rc, f.rc) << f.what;
        EXPECT_EQ(o.msg, f.msg) << f.what;
    }

    // Location-only messages put the file and line where the text wants them.
    verify(faults[4].buf);
    std::string text = rytest::error_text();
    EXPECT_NE(text.find("(security/ACL/lib/ryacl_acl:"), std::string::npos) << text;
}

TEST(ByteOrder, WorkedExampleReversedConvertsBack) {
    const bytes host = worked_example();
    ASSERT_EQ(host.size(), 61u);
    const bytes rev = reversed(host);
    ASSERT_NE(rev, host);
    EXPECT_EQ(rev[5 + 3], 0x27);  // the length field really was reversed

    sec_buffer_desc d = own(rev);
    ASSERT_EQ(sec_convert_acl_to_host(0, &d), 0);
    EXPECT_EQ(view(d), host);
    ASSERT_EQ(sec_convert_acl_to_host(1, &d), 0);
    EXPECT_EQ(view(d), host);
    drop(d);

    // A host-order buffer without verify is not walked: garbage stays.
    bytes junk = {0x85, 1, 2, 9, 9, 0xff, 0xff};
    d = own(junk);
    EXPECT_EQ(sec_convert_acl_to_host(0, &d), 0);
    EXPECT_EQ(view(d), junk);
    EXPECT_EQ(sec_convert_acl_to_host(1, &d), ACL_RC_BAD_ACL);
    drop(d);

    // A reversed buffer that breaks part-way keeps byte 2.
    bytes broken = reversed(make_acl({subacl(16, "", {{1, "a"}}), subacl(16, "", {{2, "b"}})}));
    broken[5] ^= 1;  // first length, now in reversed order: low bit of the top byte
    broken[8] ^= 1;
    d = own(broken);
    EXPECT_EQ(sec_convert_acl_to_host(0, &d), ACL_RC_BAD_ACL);
    EXPECT_EQ(rytest::error_msgnum(), 97);
    EXPECT_EQ(static_cast<unsigned char *>(d.value)[2], 1);
    drop(d);
}

TEST(ByteOrder, NotAnAclBuffer) {
    EXPECT_EQ(sec_convert_acl_to_host(1, nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("sec_convert_acl_to_host"), std::string::npos);
    for (bytes b : {bytes{}, bytes{0x84, 1, 2, 0, 0}, bytes{0x85, 2, 2, 0, 0}}) EXPECT_EQ(verify(b).msg, 96);
    sec_buffer_desc lying{5, nullptr};
    EXPECT_EQ(sec_convert_acl_to_host(0, &lying), ACL_RC_BAD_ACL);
    EXPECT_EQ(rytest::error_msgnum(), 96);
}

// Every bit flipped, every value at the header and the fields of the first
// sub-ACL and entry, every truncation: each mutant, in host and reversed
// order, is refused with a buffer code or accepted, and an accepted one
// validates again unchanged.  Reads outside the block are the sanitizer's
// to catch.
TEST(Mutation, EveryMutantIsRefusedOrHandled) {
    const bytes host = make_acl({subacl(4, "unix", {{3, "Alice"}, {1, "bob"}}), subacl(2, "", {{1, ""}}),
                            subacl(16, "", {{4, "staff"}})});
    size_t accepted = 0;
    for (const bytes &base : {host, reversed(host)}) {
        for (const bytes &m : mutants(base, {2, 3, 4, 5, 8, 9, 10, 13, 14, 15, 20, 25, 26})) {
            sec_buffer_desc d = own(m);
            const bool host_order = m.size() > 2 && m[2] == 2;
            int32_t rc = sec_convert_acl_to_host(1, &d);
            if (rc == 0) {
                ++accepted;
                // Reversal does not validate; validation of what it made
                // must not change it either.
                bytes once = view(d);
                int32_t again = sec_convert_acl_to_host(1, &d);
                if (host_order) {
                    EXPECT_EQ(again, 0);
                }
                EXPECT_EQ(view(d), once);
            } else {
                EXPECT_TRUE(rc == ACL_RC_BAD_ACL || rc == ACL_RC_BAD_ACLE) << rc;
                EXPECT_EQ(rytest::error_code(), rc);
            }
            std::free(d.value);
        }
    }
    EXPECT_GT(accepted, 0u);
}

TEST(CopyAndCreate, ParametersCopiesAndMemory) {
    sec_buffer_desc d{7, reinterpret_cast<void *>(0x1)};
    const unsigned char data[] = {1, 2, 3};
    EXPECT_EQ(sec_read_acl_from_data(0, data, &d), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 1"), std::string::npos);
    EXPECT_EQ(sec_read_acl_from_data(3, nullptr, &d), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 2"), std::string::npos);
    EXPECT_EQ(sec_read_acl_from_data(3, data, nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 3"), std::string::npos);
    EXPECT_EQ(d.length, 7);  // refused calls touch nothing

    // Bytes that are no ACL are copied all the same.
    ASSERT_EQ(sec_read_acl_from_data(3, data, &d), 0);
    EXPECT_EQ(view(d), (bytes{1, 2, 3}));
    drop(d);

    sec_buffer_desc kept{9, reinterpret_cast<void *>(0x2)};
    rytest::for_each_alloc_failure(
        [&] { return sec_read_acl_from_data(3, data, &kept); },
        [&](int32_t rc, long) {
            EXPECT_EQ(rc, ACL_RC_NO_MEMORY);
            EXPECT_EQ(rytest::error_msgnum(), 89);
            EXPECT_EQ(kept.length, 9);
        });
    drop(kept);

    EXPECT_EQ(sec_create_empty_acl(nullptr), ACL_RC_BAD_ARGS);
    sec_buffer_desc e{0, nullptr};
    ASSERT_EQ(sec_create_empty_acl(&e), 0);
    EXPECT_EQ(view(e), (bytes{0x85, 1, 2, 0, 0}));
    EXPECT_EQ(sec_release_acl(&e), 0);
    EXPECT_EQ(e.length, 0);
    EXPECT_EQ(e.value, nullptr);

    sec_buffer_desc f{3, nullptr};
    rytest::alloc_fail_nth(1);
    EXPECT_EQ(sec_create_empty_acl(&f), ACL_RC_NO_MEMORY);
    rytest::alloc_fail_none();
    EXPECT_EQ(f.value, nullptr);
    EXPECT_EQ(f.length, 3);
}

TEST(Release, OnlyAnAclBlockIsFreed) {
    EXPECT_EQ(sec_release_acl(nullptr), 0);
    sec_buffer_desc none{0, nullptr};
    EXPECT_EQ(sec_release_acl(&none), 0);

    sec_buffer_desc other = own({0x11, 1, 2, 0, 0});
    EXPECT_EQ(sec_release_acl(&other), ACL_RC_BAD_ACL);
    EXPECT_EQ(rytest::error_msgnum(), 93);
    EXPECT_EQ(other.length, 5);
    ASSERT_NE(other.value, nullptr);
    EXPECT_EQ(static_cast<unsigned char *>(other.value)[0], 0x11);
    drop(other);

    // A length without a block is not read through.
    sec_buffer_desc lying{5, nullptr};
    EXPECT_EQ(sec_release_acl(&lying), ACL_RC_BAD_ACL);
    EXPECT_EQ(lying.length, 5);

    // Success clears an error left by an earlier call.
    sec_buffer_desc ok = own({0x85, 1, 2, 0, 0});
    EXPECT_EQ(sec_release_acl(&ok), 0);
    EXPECT_EQ(rytest::error_code(), 0);
}

}  // namespace
