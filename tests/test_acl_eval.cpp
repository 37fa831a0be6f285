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

struct result {
    int32_t rc;
    uint32_t perm;
    int32_t msg;
};

result single(const bytes &b, unsigned type, const char *mech, const char *id,
              const char *zmech = nullptr) {
    sec_buffer_desc d = own(b);
    uint32_t perm = 0xdead;
    int32_t rc = sec__single_acle_perm(&d, static_cast<unsigned char>(type), mech, zmech, id, &perm);
    result r{rc, perm, rytest::error_msgnum()};
    drop(d);
    return r;
}

result groups(const bytes &b, const std::vector<const char *> &names, int32_t count = -2) {
    sec_buffer_desc d = own(b);
    std::vector<sec_buffer_desc> g;
    for (const char *n : names) g.push_back({0, const_cast<char *>(n)});
    uint32_t perm = 0xdead;
    int32_t rc = sec__group_acles_perm(&d, count == -2 ? static_cast<int32_t>(g.size()) : count,
                                       g.data(), &perm);
    result r{rc, perm, rytest::error_msgnum()};
    drop(d);
    return r;
}

const bytes kAcl = make_acl({subacl(4, "unix", {{1, "alice"}, {2, "bob"}, {4, "carol"}}),
                        subacl(2, "", {{0x10, ""}}), subacl(1, "", {{0x20, ""}}),
                        subacl(16, "", {{1, "adm"}, {4, "staff"}, {8, "wheel"}}),
                        subacl(8, "krb", {{0x100, "x/one"}, {0x200, "x/two"}}),
                        subacl(4, "krb", {{0x40, "alice"}})});

// Handlers keep what they saw, so tests can tell which entries were tried.
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
int32_t h_suffix(const char *client, const char *entry) {
    // "two" matches "x/two": a handler's own notion of identity.
    ++g_calls;
    size_t c = std::strlen(client), e = std::strlen(entry);
    return e >= c && std::strcmp(entry + e - c, client) == 0 ? 0 : -1;
}
int32_t h_first(const char *, const char *) { return 0; }
int32_t h_second(const char *, const char *) { return 1; }

TEST(Registry, ParametersAndMechanismLength) {
    struct refusal {
        uint32_t type;
        const char *mech;
        sec_acl_id_handler h;
        const char *says;
    };
    for (const refusal &r : {refusal{3, "m", h_first, "number: 1\n\tParameter value: 0x3"},
                             refusal{0, "m", h_first, "number: 1"}, refusal{1, nullptr, h_first, "number: 2"},
                             refusal{1, "m", nullptr, "number: 3"}, refusal{1, "", h_first, "4471-132"},
                             refusal{1, "abcdefghijklmnopq", h_first, "4471-132"}}) {
        EXPECT_EQ(sec__register_id_handler(r.type, r.mech, r.h), ACL_RC_BAD_ARGS);
        EXPECT_NE(rytest::error_text().find(r.says), std::string::npos) << r.says;
    }
    EXPECT_EQ(sec__register_id_handler(1, "abcdefghijklmnop", h_first), 0);
    EXPECT_EQ(rytest::error_code(), 0);
}

TEST(Registry, FirstRegistrationWinsAndCaseIsIgnored) {
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "regA", h_first), 0);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "REGa", h_second), 0);
    sec_acl_id_handler h = nullptr;
    EXPECT_EQ(sec__get_id_handler(SEC_ID_HANDLER_USER, "rega", &h), 0);
    EXPECT_EQ(h, &h_first);
    EXPECT_EQ(sec__get_id_handler(SEC_ID_HANDLER_EXPANDED, "regA", &h), 0);
    EXPECT_EQ(h, nullptr);
    EXPECT_EQ(sec__get_id_handler(SEC_ID_HANDLER_USER, "regB", &h), 0);
    EXPECT_EQ(h, nullptr);

    // Many registrations: every one stays findable across block growth.
    std::vector<std::string> names;
    for (int i = 0; i < 100; ++i) names.push_back("grow" + std::to_string(i));
    for (const std::string &n : names) ASSERT_EQ(sec__register_id_handler(1, n.c_str(), h_second), 0);
    for (const std::string &n : names) {
        sec__get_id_handler(1, n.c_str(), &h);
        EXPECT_EQ(h, &h_second) << n;
    }
}

TEST(Registry, MemoryFailureLeavesTheRegistryAsItWas) {
    long sites = rytest::for_each_alloc_failure(
        [] {
            // Enough registrations to need a bigger block at least once.
            for (int i = 0; i < 70; ++i) {
                std::string m = "oom" + std::to_string(i);
                if (int32_t rc = sec__register_id_handler(2, m.c_str(), h_first)) return rc;
            }
            return 0;
        },
        [](int32_t rc, long) {
            EXPECT_EQ(rc, ACL_RC_NO_MEMORY);
            EXPECT_EQ(rytest::error_msgnum(), 89);
            sec_acl_id_handler h = nullptr;
            sec__get_id_handler(SEC_ID_HANDLER_USER, "regA", &h);
            EXPECT_EQ(h, &h_first);
        });
    EXPECT_GE(sites, 1);
}

TEST(Evaluation, ParameterAndBufferChecksInOrder) {
    sec_buffer_desc d = own(kAcl);
    uint32_t perm = 7;
    EXPECT_EQ(sec__single_acle_perm(nullptr, 2, nullptr, nullptr, nullptr, nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 1"), std::string::npos);
    EXPECT_EQ(sec__single_acle_perm(&d, 2, nullptr, nullptr, nullptr, nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 6"), std::string::npos);
    EXPECT_EQ(sec__single_acle_perm(&d, 16, "unix", nullptr, "alice", &perm), ACL_RC_BAD_ARGS);
    EXPECT_EQ(rytest::error_msgnum(), 115);
    EXPECT_NE(rytest::error_text().find("(16)"), std::string::npos);
    EXPECT_EQ(sec__single_acle_perm(&d, 0x83, "unix", nullptr, "alice", &perm), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("(131)"), std::string::npos);
    EXPECT_EQ(sec__single_acle_perm(&d, 4, "", nullptr, "alice", &perm), ACL_RC_BAD_ARGS);
    EXPECT_EQ(rytest::error_msgnum(), 116);
    EXPECT_EQ(sec__single_acle_perm(&d, 8, "krb", nullptr, nullptr, &perm), ACL_RC_BAD_ARGS);
    EXPECT_EQ(rytest::error_msgnum(), 117);
    EXPECT_EQ(perm, 7u);  // refused calls leave the result alone

    static_cast<unsigned char *>(d.value)[2] = 1;
    EXPECT_EQ(sec__single_acle_perm(&d, 2, nullptr, nullptr, nullptr, &perm), ACL_RC_BAD_ACL);
    EXPECT_EQ(rytest::error_msgnum(), 102);
    EXPECT_EQ(sec__group_acles_perm(&d, 0, nullptr, &perm), ACL_RC_BAD_ACL);
    EXPECT_EQ(rytest::error_msgnum(), 102);
    static_cast<unsigned char *>(d.value)[1] = 2;
    EXPECT_EQ(sec__single_acle_perm(&d, 2, nullptr, nullptr, nullptr, &perm), ACL_RC_BAD_ACL);
    EXPECT_EQ(rytest::error_msgnum(), 96);
    drop(d);
    EXPECT_EQ(sec__single_acle_perm(&d, 2, nullptr, nullptr, nullptr, &perm), ACL_RC_BAD_ACL);
    EXPECT_EQ(rytest::error_msgnum(), 96);

    EXPECT_EQ(sec__group_acles_perm(nullptr, 1, nullptr, &perm), ACL_RC_BAD_ARGS);
    d = own(kAcl);
    EXPECT_EQ(sec__group_acles_perm(&d, 1, nullptr, &perm), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 3"), std::string::npos);
    EXPECT_EQ(sec__group_acles_perm(&d, 0, nullptr, nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 4"), std::string::npos);
    sec_buffer_desc holes[2] = {{0, const_cast<char *>("adm")}, {0, nullptr}};
    EXPECT_EQ(sec__group_acles_perm(&d, 2, holes, &perm), ACL_RC_BAD_ARGS);
    EXPECT_EQ(perm, 7u);
    drop(d);
}

TEST(Evaluation, UnauthenticatedAndAnyother) {
    EXPECT_EQ(single(kAcl, 1, nullptr, nullptr).perm, 0x20u);
    EXPECT_EQ(single(kAcl, 2, "whatever", "", nullptr).perm, 0x10u);
    EXPECT_EQ(single(kAcl, 2, nullptr, nullptr).rc, 0);

    result r = single(make_acl({subacl(1, "", {{1, ""}})}), 2, nullptr, nullptr);
    EXPECT_EQ(r.rc, ACL_RC_BAD_ACLE);
    EXPECT_EQ(r.msg, 134);
    EXPECT_EQ(r.perm, 0u);
    r = single(make_acl({subacl(2, "", {{1, ""}, {2, ""}})}), 2, nullptr, nullptr);
    EXPECT_EQ(r.rc, ACL_RC_BAD_ACL);
    EXPECT_EQ(r.msg, 109);
    // An anyother sub-ACL of no entries (made outside) grants nothing.
    r = single(make_acl({subacl(2, "", {})}), 2, nullptr, nullptr);
    EXPECT_EQ(r.rc, ACL_RC_BAD_ACLE);
    EXPECT_EQ(r.msg, 134);
}

TEST(Evaluation, UserWalkMatchesWithoutCaseAndStopsAfterTheName) {
    EXPECT_EQ(single(kAcl, 4, "UNIX", "Alice").perm, 1u);
    EXPECT_EQ(single(kAcl, 4, "unix", "CAROL").perm, 4u);
    EXPECT_EQ(single(kAcl, 4, "krb", "alice").perm, 0x40u);
    result r = single(kAcl, 4, "unix", "dave");
    EXPECT_EQ(r.rc, ACL_RC_BAD_ACLE);
    EXPECT_EQ(r.msg, 134);
    EXPECT_NE(rytest::error_text().find("(dave)"), std::string::npos);
    r = single(kAcl, 4, "nfs", "alice");
    EXPECT_EQ(r.msg, 134);
    EXPECT_NE(rytest::error_text().find("mechanism (nfs) and the identifier ()"), std::string::npos);

    // Out of order (made outside): "a" sorts before "b", so the walk ends
    // at "b" and never sees the later "a".
    bytes disorder = make_acl({subacl(4, "unix", {{1, "b"}, {2, "a"}})});
    EXPECT_EQ(single(disorder, 4, "unix", "a").rc, ACL_RC_BAD_ACLE);
    EXPECT_EQ(single(disorder, 4, "unix", "b").perm, 1u);

    // zmech picks the sub-ACL.
    EXPECT_EQ(single(kAcl, 4, "unix", "alice", "krb").perm, 0x40u);
}

TEST(Evaluation, HandlersSteerTheWalkAndNeverLeaveErrors) {
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "unix", h_exact), 0);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "neg", h_negative), 0);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "krb", h_suffix), 0);

    // Without 0x80 the handler is not consulted.
    g_calls = 0;
    EXPECT_EQ(single(kAcl, 4, "unix", "Bob").perm, 2u);
    EXPECT_EQ(g_calls, 0);
    // With it the handler decides: exact case only, and positive results go on.
    g_calls = 0;
    result r = single(kAcl, 0x84, "unix", "carol");
    EXPECT_EQ(r.rc, 0);
    EXPECT_EQ(r.perm, 4u);
    EXPECT_EQ(g_calls, 3);
    EXPECT_EQ(rytest::error_code(), 0);
    r = single(kAcl, 0x84, "unix", "Bob");
    EXPECT_EQ(r.rc, ACL_RC_BAD_ACLE);
    EXPECT_EQ(r.msg, 134);

    // A negative result ends the walk at the first entry.
    bytes negacl = make_acl({subacl(4, "neg", {{1, "a"}, {2, "b"}})});
    g_calls = 0;
    r = single(negacl, 0x84, "neg", "b");
    EXPECT_EQ(r.rc, ACL_RC_BAD_ACLE);
    EXPECT_EQ(g_calls, 1);
    EXPECT_EQ(g_last, "a");

    // 0x80 with no handler for the mechanism is the plain comparison.
    EXPECT_EQ(single(kAcl, 0x84, "krb", "ALICE").perm, single(kAcl, 4, "krb", "ALICE").perm);

    // Expanded entries match only through their handler; zmech picks the
    // sub-ACL while the handler is looked up under mech.
    EXPECT_EQ(single(kAcl, 8, "krb", "two").perm, 0x200u);
    EXPECT_EQ(single(kAcl, 8, "nohandler", "x/one", "krb").rc, ACL_RC_BAD_ACLE);
    EXPECT_EQ(single(kAcl, 8, "krb", "x/one", "KRB").perm, 0x100u);
    bytes exp2 = make_acl({subacl(8, "other", {{0x1, "q/two"}})});
    EXPECT_EQ(single(exp2, 8, "krb", "two", "other").perm, 0x1u);
    EXPECT_EQ(single(exp2, 8, "other", "q/two").msg, 134);
}

TEST(Evaluation, GroupsCombineAndCountEdges) {
    result r = groups(kAcl, {"STAFF", "adm"});
    EXPECT_EQ(r.rc, 0);
    EXPECT_EQ(r.perm, 5u);
    EXPECT_EQ(groups(kAcl, {"staff", "staff", "nobody"}).perm, 4u);
    r = groups(kAcl, {});
    EXPECT_EQ(r.rc, 0);
    EXPECT_EQ(r.perm, 0u);
    r = groups(kAcl, {"adm"}, -1);
    EXPECT_EQ(r.rc, ACL_RC_BAD_ACLE);
    EXPECT_EQ(r.msg, 134);
    EXPECT_EQ(r.perm, 0u);
    r = groups(kAcl, {"nobody"});
    EXPECT_EQ(r.rc, ACL_RC_BAD_ACLE);
    EXPECT_EQ(r.perm, 0u);
    r = groups(make_acl({subacl(2, "", {{1, ""}})}), {"adm"});
    EXPECT_EQ(r.rc, ACL_RC_BAD_ACLE);
    EXPECT_NE(rytest::error_text().find("type (16)"), std::string::npos);
}

// Every mutant of a valid buffer through both evaluations: a result or a
// clean refusal, never a read outside the block (the sanitizer's part).
TEST(Mutation, EvaluationsOfEveryMutant) {
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_USER, "mut", h_exact), 0);
    ASSERT_EQ(sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "mut", h_exact), 0);
    const bytes base = make_acl({subacl(4, "mut", {{1, "ann"}, {2, "bo"}}), subacl(2, "", {{4, ""}}),
                            subacl(8, "mut", {{8, "e1"}}), subacl(16, "", {{16, "g"}})});
    auto clean = [](int32_t rc) {
        return rc == 0 || rc == ACL_RC_BAD_ACL || rc == ACL_RC_BAD_ACLE;
    };
    for (const bytes &m : mutants(base, {3, 5, 9, 10, 14, 19, 20})) {
        for (unsigned type : {1u, 2u, 4u, 0x84u, 8u}) {
            result r = single(m, type, "mut", "bo");
            EXPECT_TRUE(clean(r.rc)) << r.rc;
            if (r.rc) {
                EXPECT_EQ(rytest::error_code(), r.rc);
            }
        }
        EXPECT_TRUE(clean(groups(m, {"g", "h"}).rc));
    }
}

}  // namespace
