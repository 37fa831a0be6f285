// Compiled ACLs from outside: validation, byte order, copy, create, release; refused arguments of every operation.
#include <gtest/gtest.h>

#include <regex>

#include "lib_acl_bytes.h"
#include "ryacl_acl_dump.h"
#include "ryacl_acl_edit.h"

namespace {

using namespace libtest;

// "function position" named by message 88, else "code/message".
std::string refusal(int32_t rc) {
    const std::string t = rytest::error_text();
    const size_t f = t.find("name: ") + 6, p = t.find("number: ") + 8;
    return with_msg(rc) == rc_msg(4, 88) ? t.substr(f, t.find('\n', f) - f) + " " + t.substr(p, t.find('\n', p) - p)
                                         : code(rc);
}
bytes set(bytes b, size_t off, unsigned value) { return b[off] = static_cast<unsigned char>(value), b; }

// Each fault with its code and message.  (Every operation on such bytes unvalidated: fuzz_acl_buffer.)
TEST(Validation, EachRuleWithItsCodeAndMessage) {
    const bytes user = make_acl({subacl(4, "unix", {{1, "ann"}})}), group = make_acl({subacl(16, "", {{1, "staff"}})});
    const bytes groups2 = make_acl({subacl(16, "", {{1, "staff"}}), subacl(16, "", {{1, "staff"}})});
    bytes lying_id = set(make_acl({subacl(16, "", {{1, "staff"}, {2, "wheel"}})}), 33, 7);  // "wheel" is 6
    lying_id.push_back(0);
    const struct { const char *what; bytes buf; const char *want, *says = ""; } rows[] = {
        {"empty ACL", {0x85, 1, 2, 0, 0}, "0/0"}, {"worked example", worked_example(), "0/0"}, {"no bytes", {}, "42/96"},
        {"buffer type", {0x84, 1, 2, 0, 0}, "42/96"}, {"version", {0x85, 2, 2, 0, 0}, "42/96"},
        {"short header", {0x85, 1, 2, 0}, "42/106", "Its length (4)"},
        {"mech length 1", set(user, 14, 1), "42/110"}, {"mech length 18", set(user, 14, 18), "42/110"},
        {"mech text shorter than its length", set(user, 14, 6), "42/111"},
        {"two anyother entries", make_acl({subacl(2, "", {{1, ""}, {2, ""}})}), "42/109"},
        {"identifier in an anyother entry", set(make_acl({subacl(2, "", {{1, ""}})}), 20, 1), "43/113",
         "(security/ACL/lib/ryacl_acl:"},  // where the text wants the location
        {"entry version, only sub-ACL", set(group, 15, 2), "43/112"},
        {"entry version, first of two",
         set(make_acl({subacl(16, "", {{1, "staff"}}), subacl(4, "unix", {{1, "ann"}})}), 15, 2), "42/97"},
        {"identifier text and length disagree", lying_id, "43/114"}, {"unknown type", set(group, 9, 3), "42/107"},
        {"mechanism in a group sub-ACL", set(group, 14, 2), "42/108"},
        {"sub-ACL longer than where the next starts", set(groups2, 5, groups2[5] + 1u), "42/97"},
        {"entry count past the end", set(group, 10, 200), "42/97"}, {"sub-ACL count past the end", set(group, 3, 2), "42/97"},
        {"sub-ACL length past the end", set(group, 8, 0x7f), "42/97"},
        {"identifier cut by the end", bytes(group.begin(), group.end() - 1), "42/97"},
    };
    for (const auto &r : rows) {
        sec_buffer_desc d = own(r.buf);
        EXPECT_EQ(refusal(sec_convert_acl_to_host(1, &d)), r.want) << r.what;
        EXPECT_NE(rytest::error_text().find(r.says), std::string::npos) << r.what;
        drop(d);
    }
}

// Host order is walked only to verify; a break part-way keeps byte 2.  (Reversed and back for any well-formed ACL:
// fuzz_acl_buffer.)
TEST(Buffers, ByteOrderCopyCreateRelease) {
    const bytes host = worked_example(), junk = {0x85, 1, 2, 9, 9, 0xff, 0xff};
    bytes broken = reversed(make_acl({subacl(16, "", {{1, "a"}}), subacl(16, "", {{2, "b"}})}));
    broken[5] ^= 1, broken[8] ^= 1;  // the first length, reversed: low bit of its top byte
    const struct { bytes in; int verify; const char *want; bytes out; } rows[] = {
        {reversed(host), 0, "0/0", host}, {junk, 0, "0/0", junk}, {junk, 1, "42/97", junk}, {broken, 0, "42/97", {}}};
    for (const auto &r : rows) {
        sec_buffer_desc d = own(r.in);
        EXPECT_EQ(refusal(sec_convert_acl_to_host(r.verify, &d)), r.want);
        EXPECT_TRUE(r.out.empty() ? view(d)[2] == 1 : view(d) == r.out);
        drop(d);
    }
    sec_buffer_desc d{0, nullptr}, lying{5, nullptr};  // a length alone is never read through
    const unsigned char data[] = {1, 2, 3};
    EXPECT_EQ(refusal(sec_convert_acl_to_host(0, &lying)), "42/96");
    EXPECT_TRUE(refusal(sec_release_acl(&lying)) == "42/93" && lying.length == 5);
    ASSERT_EQ(sec_read_acl_from_data(3, data, &d), 0);  // no ACL, copied all the same
    EXPECT_TRUE(refusal(sec_release_acl(&d)) == "42/93" && view(d) == bytes({1, 2, 3}));  // only an ACL block is freed
    drop(d);
    EXPECT_TRUE(sec_release_acl(nullptr) == 0 && sec_create_empty_acl(&d) == 0 && view(d) == bytes({0x85, 1, 2, 0, 0}));
    EXPECT_TRUE(refusal(sec_release_acl(&d)) == "0/0" && d.length == 0 && !d.value);  // clears the create's error too
    for (int32_t length : {0, -1, INT32_MIN}) {  // an ACL block is freed whatever the length (the leak checkers see it)
        d = own(host);
        d.length = length;
        EXPECT_EQ(refusal(sec_release_acl(&d)), "0/0") << length;
        EXPECT_TRUE(d.length == 0 && !d.value) << length;
    }
}

// What every operation makes of a buffer: validation, listings, evaluations, each edit (on either road) with the
// validation and listing of its result, and the dump with the sub-ACL lengths it shows left out.
strings outcomes(const bytes &b) {
    sec_buffer_desc d = own(b);
    strings r{"valid " + code(sec_convert_acl_to_host(1, &d))};
    auto add = [&](const std::string &what, const strings &l) { for (const std::string &x : l) r.push_back(what + " " + x); };
    add("all", list(d));
    for (int t : {1, 2, 4, 8, 16}) add("type " + std::to_string(t), list(d, t, t == 4 ? "UNIX" : nullptr));
    for (auto [t, id] : {std::pair{1, ""}, {2, ""}, {4, "alice"}, {4, "bob"}, {4, "zed"}, {8, "x"}}) {
        uint32_t perm = 7;
        const std::string rc = code(sec__single_acle_perm(&d, static_cast<unsigned char>(t), "unix", nullptr, id, &perm));
        r.push_back("eval " + rc + " " + std::to_string(perm));
    }
    sec_buffer_desc g[] = {{0, const_cast<char *>("staff")}, {0, const_cast<char *>("wheel")}};
    uint32_t perm = 7;
    const std::string rc = code(sec__group_acles_perm(&d, 2, g, &perm));
    r.push_back("groups " + rc + " " + std::to_string(perm));
    const struct { char kind; unsigned type; const char *mech, *id; } edits[] = {
        {'+', 4, "unix", "carol"}, {'+', 4, "unix", "alice"}, {'2', 4, "unix", "bob"}, {'-', 4, "unix", "bob"},
        {'+', 2, "", ""}, {'-', 2, "", ""}, {'+', 16, "", "ops"}, {'-', 16, "", "wheel"}, {'+', 8, "krb", "x"}};
    for (const auto &o : edits)
        for (bool direct : {true, false}) {
            acl__edit_direct_enabled = direct;
            sec_buffer_desc c = own(b);
            sec_acle_desc e = entry(o.type, 0x40, o.mech, o.id);
            const int32_t rc = o.kind == '-' ? sec_del_acle_from_acl(&e, &c)
                                             : o.kind == '2' ? sec_add_acle_to_acl2(&e, &c) : sec_add_acle_to_acl(&e, &c);
            const std::string what = std::string(1, o.kind) + o.id + " " + code(rc);
            if (rc) r.push_back(what + (view(c) == b ? "" : " changed the bytes"));
            else {
                const std::string valid = code(sec_convert_acl_to_host(1, &c));
                add(what + " then valid " + valid, list(c));
            }
            drop(c);
        }
    acl__edit_direct_enabled = true;
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    sec__dump_acl(&d);
    const std::string err = testing::internal::GetCapturedStderr(), out = testing::internal::GetCapturedStdout();
    r.push_back(std::regex_replace(err + out, std::regex("length = [0-9]+"), "length = ?"));
    drop(d);
    return r;
}

// Validation never compares the last sub-ACL's length with its entries (and bytes after them are let be), but no
// length may run past the block.  For every length the last sub-ACL can have, every operation reads what the same
// buffer with that length exact gives.
TEST(Validation, EveryLengthOfTheLastSubaclThatPassesReadsAlike) {
    bytes trailing = make_acl({subacl(16, "", {{1, "adm"}, {4, "staff"}}), subacl(4, "unix", {{3, "alice"}, {1, "bob"}})});
    trailing.insert(trailing.end(), {0, 1, 0x85});
    const bytes bases[] = {worked_example(), trailing, make_acl({subacl(16, "", {{2, "wheel"}})}),
                           make_acl({subacl(4, "unix", {{1, "bob"}}), subacl(2, "", {})})};
    for (const bytes &base : bases) {
        size_t last = 5;
        for (uint32_t s = 1; s < get(base, 3, 2); ++s) last += get(base, last, 4);
        const strings want = outcomes(base);
        ASSERT_EQ(want.front(), "valid 0/0");
        for (size_t len = 0; len <= base.size() - last + 1; ++len) {
            bytes b = base;
            for (size_t i = 0; i < 4; ++i) b[last + i] = static_cast<unsigned char>(len >> (8 * i));
            if (len == base.size() - last + 1) {  // one byte past the block
                sec_buffer_desc d = own(b);
                EXPECT_EQ(refusal(sec_convert_acl_to_host(1, &d)), "42/97");
                drop(d);
            } else {
                EXPECT_EQ(outcomes(b), want) << len;
            }
        }
    }
}

// One table per family: a refused call names the function and the argument; arguments are checked before the buffer
// they describe, and outputs are left alone.
TEST(RefusedArguments, NameTheFunctionAndThePosition) {
    sec_buffer_desc d{7, reinterpret_cast<void *>(0x1)}, acl = own(worked_example()), none{0, nullptr};
    const unsigned char data[] = {1, 2, 3};
    EXPECT_EQ(refusal(sec_convert_acl_to_host(1, nullptr)), "sec_convert_acl_to_host 1");
    EXPECT_EQ(refusal(sec_read_acl_from_data(0, data, &d)), "sec_read_acl_from_data 1");
    EXPECT_EQ(refusal(sec_read_acl_from_data(3, data, nullptr)), "sec_read_acl_from_data 3");
    EXPECT_EQ(refusal(sec_create_empty_acl(nullptr)), "sec_create_empty_acl 1");
    EXPECT_EQ(refusal(sec_read_acl_file(nullptr, nullptr, nullptr, 0, &d, nullptr)), "sec_read_acl_file 1");
    EXPECT_EQ(refusal(sec_read_acl_file("acl", "", nullptr, 0, nullptr, nullptr)), "sec_read_acl_file 5");
    EXPECT_EQ(refusal(sec_read_acl_file("acl", "", nullptr, 0, &d, nullptr)), "4/121");

    sec_acle_desc e = entry(4, 1, "unix", "x");
    EXPECT_EQ(refusal(sec_add_acle_to_acl(nullptr, &acl)), "sec_add_acle_to_acl 1");
    EXPECT_EQ(refusal(sec_add_acle_to_acl2(&e, nullptr)), "sec_add_acle_to_acl 2");  // one body, one name
    EXPECT_EQ(refusal(sec_del_acle_from_acl(&e, nullptr)), "sec_del_acle_from_acl 2");

    sec_acle_list_desc l{0, nullptr};
    EXPECT_EQ(refusal(sec_list_acl(&acl, nullptr)), "sec_list_acl 2");
    EXPECT_EQ(refusal(sec_list_acl_by_type(nullptr, 4, nullptr, &l)), "sec_list_acl_by_type 1");
    EXPECT_EQ(refusal(sec_list_acl_by_type(&acl, 3, nullptr, &l)), "sec_list_acl_by_type 2");
    EXPECT_NE(rytest::error_text().find("Parameter value: 0x3\n"), std::string::npos);
    EXPECT_EQ(refusal(sec_list_acl_by_type(&acl, 4, "abcdefghijklmnopq", &l)), "sec_list_acl_by_type 3");
    EXPECT_EQ(refusal(sec_list_acl_by_type(&acl, 4, nullptr, nullptr)), "sec_list_acl_by_type 4");

    uint32_t perm = 7;
    sec_buffer_desc holes[2] = {{0, const_cast<char *>("adm")}, {0, nullptr}};
    EXPECT_EQ(refusal(sec__single_acle_perm(nullptr, 2, nullptr, nullptr, nullptr, &perm)), "sec__single_acle_perm 1");
    EXPECT_EQ(refusal(sec__single_acle_perm(&none, 2, nullptr, nullptr, nullptr, nullptr)), "sec__single_acle_perm 6");
    EXPECT_EQ(refusal(sec__group_acles_perm(&none, 1, nullptr, nullptr)), "sec__group_acles_perm 3");
    EXPECT_EQ(refusal(sec__group_acles_perm(&acl, 2, holes, &perm)), "sec__group_acles_perm 3");
    EXPECT_EQ(refusal(sec__group_acles_perm(&none, 0, nullptr, nullptr)), "sec__group_acles_perm 4");
    auto h = [](const char *, const char *) -> int32_t { return 0; };
    EXPECT_EQ(refusal(sec__register_id_handler(3, "m", h)), "acl__register_id_handler 1");
    EXPECT_EQ(refusal(sec__register_id_handler(1, "m", nullptr)), "acl__register_id_handler 3");
    EXPECT_TRUE(d.length == 7 && perm == 7 && view(acl) == worked_example());
    drop(acl);
}

}  // namespace
