// Permission evaluation and the identity handler registry.
#include <gtest/gtest.h>

#include <atomic>
#include <cstring>
#include <string>
#include <vector>

#include "lib_acl_bytes.h"
#include "ry_zo_int.h"
#include "ryacl.h"
#include "ryacl_error.h"
#include "ryacl_init.h"
#include "ryacl_test_support.h"

namespace {

using namespace libtest;

struct result { int32_t rc; uint32_t perm; int32_t msg; };

result single(const bytes &b, unsigned type, const char *mech, const char *id, const char *zmech = nullptr) {
    sec_buffer_desc d = own(b);
    uint32_t perm = 0xdead;
    int32_t rc = sec__single_acle_perm(&d, static_cast<unsigned char>(type), mech, zmech, id, &perm);
    drop(d);
    return {rc, perm, rytest::error_msgnum()};
}

result groups(const bytes &b, std::vector<const char *> names, int32_t count = -2) {
    sec_buffer_desc d = own(b);
    std::vector<sec_buffer_desc> g;
    for (const char *n : names) g.push_back({0, const_cast<char *>(n)});
    uint32_t perm = 0xdead;
    int32_t rc = sec__group_acles_perm(&d, count == -2 ? static_cast<int32_t>(g.size()) : count, g.data(), &perm);
    drop(d);
    return {rc, perm, rytest::error_msgnum()};
}

const bytes kAcl = make_acl({subacl(4, "unix", {{1, "alice"}, {2, "bob"}, {4, "carol"}}), subacl(2, "", {{0x10, ""}}),
                             subacl(1, "", {{0x20, ""}}), subacl(16, "", {{1, "adm"}, {4, "staff"}, {8, "wheel"}}),
                             subacl(8, "krb", {{0x100, "x/one"}, {0x200, "x/two"}}),
                             subacl(4, "krb", {{0x40, "alice"}})});

// Handlers count their calls and keep the last entry, so tests can tell
// which entries were tried.
std::atomic<int> g_calls{0};
std::string g_last;

int32_t h_exact(const char *client, const char *entry) {
    ++g_calls;
    g_last = entry;
    acl::set_error(ACL_RC_INTERNAL, 91, "handler", 1, 2);  // must never reach the caller
    return std::strcmp(client, entry) == 0 ? 0 : 1;
}
int32_t h_negative(const char *, const char *entry) {
    ++g_calls;
    g_last = entry;
    return -7;
}
int32_t h_suffix(const char *client, const char *entry) {  // "two" is "x/two"
    size_t c = std::strlen(client), e = std::strlen(entry);
    return e >= c && std::strcmp(entry + e - c, client) == 0 ? 0 : -1;
}

TEST(Registry, RefusalsFirstRegistrationWinsAndCaseIsIgnored) {
    struct refusal { uint32_t type; const char *mech; sec_acl_id_handler h; const char *says; } const refusals[] = {
        {3, "m", h_exact, "number: 1\n\tParameter value: 0x3"}, {0, "m", h_exact, "number: 1"},
        {1, nullptr, h_exact, "number: 2"}, {1, "m", nullptr, "number: 3"}, {1, "", h_exact, "4471-132"},
        {1, "abcdefghijklmnopq", h_exact, "4471-132"}};
    for (const refusal &r : refusals) {
        EXPECT_EQ(sec__register_id_handler(r.type, r.mech, r.h), ACL_RC_BAD_ARGS);
        EXPECT_NE(rytest::error_text().find(r.says), std::string::npos) << r.says;
    }
    EXPECT_EQ(sec__register_id_handler(1, "abcdefghijklmnop", h_exact), 0);
    EXPECT_EQ(rytest::error_code(), 0);

    sec_acl_id_handler h = h_negative;
    EXPECT_EQ(sec__get_id_handler(SEC_ID_HANDLER_USER, "regA", &h), 0);
    EXPECT_EQ(h, nullptr);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "regA", h_exact), 0);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "REGa", h_negative), 0);
    EXPECT_EQ(sec__get_id_handler(SEC_ID_HANDLER_USER, "rega", &h), 0);
    EXPECT_EQ(h, &h_exact);
    EXPECT_EQ(sec__get_id_handler(SEC_ID_HANDLER_EXPANDED, "regA", &h), 0);
    EXPECT_EQ(h, nullptr);
}

TEST(Evaluation, ParameterAndBufferChecksInOrder) {
    sec_buffer_desc good = own(kAcl), swapped = own(kAcl), alien = own(kAcl), none{0, nullptr};
    static_cast<unsigned char *>(swapped.value)[2] = 1;
    static_cast<unsigned char *>(alien.value)[1] = 2;
    uint32_t perm = 7;
    // Each call breaks two checks; the earlier one is reported.
    struct call { sec_buffer_desc *acl; unsigned type; const char *mech, *id; uint32_t *perm; rc_msg want;
                  const char *says; } const calls[] = {
        {nullptr, 2, nullptr, nullptr, nullptr, {4, 88}, "number: 1"},
        {&alien, 2, nullptr, nullptr, nullptr, {4, 88}, "number: 6"},
        {&none, 16, nullptr, nullptr, &perm, {42, 96}, ""},
        {&alien, 16, nullptr, nullptr, &perm, {42, 96}, ""},
        {&swapped, 16, nullptr, nullptr, &perm, {42, 102}, ""},
        {&good, 16, nullptr, nullptr, &perm, {4, 115}, "(16)"},
        {&good, 0x83, "unix", "alice", &perm, {4, 115}, "(131)"},
        {&good, 4, "", nullptr, &perm, {4, 116}, ""},
        {&good, 8, "krb", nullptr, &perm, {4, 117}, ""},
    };
    for (const call &c : calls) {
        EXPECT_EQ(with_msg(sec__single_acle_perm(c.acl, static_cast<unsigned char>(c.type), c.mech, nullptr, c.id,
                                                 c.perm)), c.want) << c.says;
        EXPECT_NE(rytest::error_text().find(c.says), std::string::npos) << c.says;
    }
    EXPECT_EQ(sec__group_acles_perm(&alien, 1, nullptr, nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("number: 3"), std::string::npos);
    EXPECT_EQ(with_msg(sec__group_acles_perm(&swapped, 0, nullptr, &perm)), rc_msg(42, 102));
    sec_buffer_desc holes[2] = {{0, const_cast<char *>("adm")}, {0, nullptr}};
    EXPECT_EQ(sec__group_acles_perm(&good, 2, holes, &perm), ACL_RC_BAD_ARGS);
    EXPECT_EQ(perm, 7u);  // refused calls leave the result alone
    for (sec_buffer_desc *d : {&good, &swapped, &alien}) drop(*d);
}

TEST(Evaluation, SingleEntriesUsersAndMechanisms) {
    const bytes only_n = make_acl({subacl(1, "", {{1, ""}})});
    const bytes two_o = make_acl({subacl(2, "", {{1, ""}, {2, ""}})});
    const bytes no_o = make_acl({subacl(2, "", {})});  // made outside; grants nothing
    // Out of order (made outside): the walk ends at "b" and never sees "a".
    const bytes disorder = make_acl({subacl(4, "unix", {{1, "b"}, {2, "a"}})});
    struct row { const bytes &acl; unsigned type; const char *mech, *id, *zmech; int32_t rc; uint32_t perm;
                 const char *says; } const rows[] = {
        {kAcl, 1, nullptr, nullptr, nullptr, 0, 0x20, ""},
        {kAcl, 2, "whatever", "", nullptr, 0, 0x10, ""},
        {only_n, 2, nullptr, nullptr, nullptr, 43, 0, "4471-147"},
        {two_o, 2, nullptr, nullptr, nullptr, 42, 0, "4471-122"},
        {no_o, 2, nullptr, nullptr, nullptr, 43, 0, "4471-147"},
        {kAcl, 4, "UNIX", "Alice", nullptr, 0, 1, ""},
        {kAcl, 4, "unix", "CAROL", nullptr, 0, 4, ""},
        {kAcl, 4, "krb", "alice", nullptr, 0, 0x40, ""},
        {kAcl, 4, "unix", "alice", "krb", 0, 0x40, ""},
        {kAcl, 4, "unix", "dave", nullptr, 43, 0, "identifier (dave)"},
        {kAcl, 4, "nfs", "alice", nullptr, 43, 0, "mechanism (nfs) and the identifier ()"},
        {disorder, 4, "unix", "a", nullptr, 43, 0, "4471-147"},
        {disorder, 4, "unix", "b", nullptr, 0, 1, ""},
        {kAcl, 8, "nohandler", "x/one", "krb", 43, 0, "4471-147"},  // no handler, no match
    };
    for (const row &r : rows) {
        result got = single(r.acl, r.type, r.mech, r.id, r.zmech);
        EXPECT_EQ(got.rc, r.rc) << r.says;
        EXPECT_EQ(got.perm, r.perm) << r.says;
        EXPECT_NE(rytest::error_text().find(r.says), std::string::npos) << rytest::error_text();
    }
}

TEST(Evaluation, HandlersSteerTheWalkAndNeverLeaveErrors) {
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "unix", h_exact), 0);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "neg", h_negative), 0);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "krb", h_suffix), 0);

    g_calls = 0;  // without 0x80 the handler is not consulted
    EXPECT_EQ(single(kAcl, 4, "unix", "Bob").perm, 2u);
    EXPECT_EQ(g_calls, 0);
    // With it the handler decides: exact case only, positive results go on.
    EXPECT_EQ(single(kAcl, 0x84, "unix", "carol").perm, 4u);
    EXPECT_EQ(g_calls, 3);
    EXPECT_EQ(rytest::error_code(), 0);
    EXPECT_EQ(single(kAcl, 0x84, "unix", "Bob").msg, 134);

    g_calls = 0;  // a negative result ends the walk at the first entry
    EXPECT_EQ(single(make_acl({subacl(4, "neg", {{1, "a"}, {2, "b"}})}), 0x84, "neg", "b").rc, ACL_RC_BAD_ACLE);
    EXPECT_EQ(g_calls, 1);
    EXPECT_EQ(g_last, "a");

    // 0x80 with no handler for the mechanism is the plain comparison.
    EXPECT_EQ(single(kAcl, 0x84, "krb", "ALICE").perm, 0x40u);
    // Expanded entries match through their handler, looked up under mech
    // while zmech picks the sub-ACL.
    EXPECT_EQ(single(kAcl, 8, "krb", "two").perm, 0x200u);
    EXPECT_EQ(single(kAcl, 8, "krb", "x/one", "KRB").perm, 0x100u);
    const bytes other = make_acl({subacl(8, "other", {{0x1, "q/two"}})});
    EXPECT_EQ(single(other, 8, "krb", "two", "other").perm, 0x1u);
    EXPECT_EQ(single(other, 8, "other", "q/two").msg, 134);
}

TEST(Evaluation, GroupsCombineAndCountEdges) {
    struct row { std::vector<const char *> names; int32_t count, rc; uint32_t perm; } const rows[] = {
        {{"STAFF", "adm"}, -2, 0, 5}, {{"staff", "staff", "nobody"}, -2, 0, 4}, {{}, -2, 0, 0},
        {{"adm"}, -1, 43, 0}, {{"nobody"}, -2, 43, 0}};
    for (const row &r : rows) {
        result got = groups(kAcl, r.names, r.count);
        EXPECT_EQ(got.rc, r.rc) << r.names.size();
        EXPECT_EQ(got.perm, r.perm) << r.names.size();
        EXPECT_EQ(got.msg, r.rc ? 134 : 0);
    }
    EXPECT_EQ(groups(make_acl({subacl(2, "", {{1, ""}})}), {"adm"}).rc, ACL_RC_BAD_ACLE);
    EXPECT_NE(rytest::error_text().find("type (16)"), std::string::npos);
}

}  // namespace
