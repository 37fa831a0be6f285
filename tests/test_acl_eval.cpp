// Permission evaluation on compiled bytes and the identity handler registry.
#include <gtest/gtest.h>

#include "lib_acl_bytes.h"
#include "ryacl_error.h"

namespace {

using namespace libtest;

const bytes kAcl = make_acl({subacl(4, "unix", {{1, "alice"}, {2, "bob"}, {4, "carol"}}), subacl(2, "", {{0x10, ""}}),
                             subacl(1, "", {{0x20, ""}}), subacl(16, "", {{1, "adm"}, {4, "staff"}, {8, "wheel"}}),
                             subacl(8, "krb", {{0x200, "x/two"}, {0x100, "x/one"}})});

// The handler compares exactly and notes each entry it is shown.
std::string g_seen;
int32_t h_cmp(const char *client, const char *entry) {
    g_seen += std::string(entry) + ",";
    acl::set_error(ACL_RC_INTERNAL, acl::msg::INTERNAL, "handler", 1, 2);  // must never reach the caller
    return std::strcmp(client, entry);
}
int32_t h_never(const char *, const char *) { return 1; }

TEST(Evaluation, RegistryRefusalsAndBufferChecksInOrder) {
    EXPECT_EQ(code(sec__register_id_handler(1, "abcdefghijklmnopq", h_cmp)), "4/119");  // 16 characters at most
    EXPECT_EQ(code(sec__register_id_handler(1, "abcdefghijklmnop", h_cmp)), "0/0");
    sec_buffer_desc good = own(kAcl), swapped = own(kAcl), none{0, nullptr};
    static_cast<unsigned char *>(swapped.value)[2] = 1;
    uint32_t perm = 7;
    auto single = [&](sec_buffer_desc *a, unsigned t, const char *m, const char *id) {
        return code(sec__single_acle_perm(a, static_cast<unsigned char>(t), m, nullptr, id, &perm));
    };
    // Where a call breaks two checks, the earlier one is reported.
    EXPECT_EQ(single(&none, 16, nullptr, nullptr), "42/96");
    EXPECT_EQ(single(&swapped, 16, nullptr, nullptr), "42/102");
    EXPECT_EQ(code(sec__group_acles_perm(&swapped, 0, nullptr, &perm)), "42/102");
    EXPECT_EQ(single(&good, 16, nullptr, nullptr), "4/115");
    EXPECT_EQ(single(&good, 4, "", nullptr), "4/116");
    EXPECT_EQ(single(&good, 8, "krb", nullptr), "4/117");
    EXPECT_EQ(perm, 7u);  // refused calls leave the result alone
    drop(good);
    drop(swapped);
}

// "code/message permissions entries-shown", single (type set) or groups.
std::string eval(const bytes &b, unsigned type, const char *mech, const char *id, const char *zmech = nullptr,
                 std::vector<const char *> groups = {}) {
    sec_buffer_desc d = own(b);
    std::vector<sec_buffer_desc> g;
    for (const char *n : groups) g.push_back({0, const_cast<char *>(n)});
    uint32_t perm = 0xdead;
    g_seen.clear();
    const int32_t rc = type ? sec__single_acle_perm(&d, static_cast<unsigned char>(type), mech, zmech, id, &perm)
                            : sec__group_acles_perm(&d, static_cast<int32_t>(g.size()), g.data(), &perm);
    EXPECT_EQ(view(d), b);
    drop(d);
    return code(rc) + " " + std::to_string(perm) + " " + g_seen;
}

// Beyond the fuzz_acl_ops model: bytes made outside, messages, a handler's own error, the first of two registrations.
// Without 0x80 a user walk ends at the first entry ordered after the name; with it the mechanism's user handler decides,
// a negative result ending the walk.  Expanded entries match only through the handler of `mech`, walked to the end.
TEST(Evaluation, SingleEntriesAndGroups) {
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "unix", h_cmp), 0);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "UNIX", h_never), 0);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "krb", h_cmp), 0);
    const bytes only_n = make_acl({subacl(1, "", {{1, ""}})}), two_o = make_acl({subacl(2, "", {{1, ""}, {2, ""}})});
    const bytes no_o = make_acl({subacl(2, "", {})}), disorder = make_acl({subacl(4, "unix", {{1, "b"}, {2, "a"}})});
    EXPECT_EQ(eval(kAcl, 1, nullptr, nullptr), "0/0 32 ");
    EXPECT_EQ(eval(kAcl, 2, "whatever", ""), "0/0 16 ");
    EXPECT_EQ(eval(only_n, 2, nullptr, nullptr), "43/134 0 ");
    EXPECT_EQ(eval(two_o, 2, nullptr, nullptr), "42/109 0 ");
    EXPECT_EQ(eval(no_o, 2, nullptr, nullptr), "43/134 0 ");  // grants nothing
    EXPECT_EQ(eval(kAcl, 4, "unix", "dave"), "43/134 0 ");
    EXPECT_EQ(eval(kAcl, 4, "nfs", "alice"), "43/134 0 ");
    EXPECT_NE(rytest::error_text().find("mechanism (nfs) and the identifier ()"), std::string::npos);
    EXPECT_EQ(eval(disorder, 4, "unix", "a"), "43/134 0 ");
    EXPECT_EQ(eval(disorder, 4, "unix", "b"), "0/0 1 ");
    EXPECT_EQ(eval(kAcl, 0x84, "Unix", "carol"), "0/0 4 alice,bob,carol,");
    EXPECT_EQ(eval(kAcl, 0x84, "unix", "Bob"), "43/134 0 alice,");
    EXPECT_EQ(eval(kAcl, 8, "krb", "x/one"), "0/0 256 x/two,x/one,");
    EXPECT_EQ(eval(kAcl, 0, nullptr, nullptr, nullptr, {"STAFF", "nobody", "adm"}), "0/0 5 ");
    EXPECT_EQ(eval(kAcl, 0, nullptr, nullptr, nullptr, {"nobody", "wheel2"}), "43/134 0 ");  // none of the set is there
    EXPECT_EQ(eval(two_o, 0, nullptr, nullptr, nullptr, {"adm"}), "43/134 0 ");
    EXPECT_NE(rytest::error_text().find("type (16)"), std::string::npos);
}

// Buffers from outside: every bit flipped, every truncation, every value of
// the counts' and lengths' low bytes, each in a block of exactly its size.
// Evaluating and listing never read outside it (the sanitizer build checks).
TEST(Evaluation, HostileBuffersStayInsideTheBlock) {
    for (const bytes &m : mutants(kAcl, {3, 5, 10, 14, 17})) {
        for (unsigned t : {1u, 2u, 4u, 8u, 0x84u, 0u}) {
            std::string r = eval(m, t, t & 4 ? "unix" : "krb", t & 4 ? "carol" : "x/one", nullptr, {"wheel", "staff"});
            // A failure zeroes the grant, or leaves it untouched when the header is refused.
            ASSERT_TRUE(r.rfind("0/0 ", 0) == 0 || r.find(" 0 ") != std::string::npos ||
                        r.find(" 57005 ") != std::string::npos)
                << r;
        }
        sec_buffer_desc d = own(m);
        sec_acle_list_desc list{};
        if (sec_list_acl(&d, &list) != 0) {
            EXPECT_EQ(list.count, 0);
        }
        sec_release_aclelist(&list);
        drop(d);
    }
}

}  // namespace
